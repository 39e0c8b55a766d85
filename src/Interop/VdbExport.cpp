#include "Interop/VdbExport.h"

#include "Interop/IndexToWorldImpl.h"
#include "Interop/VdbGridImpl.h"
#include "Interop/VdbRecord.h"
#include "Interop/VdbWriteImpl.h"

#include <algorithm>
#include <sstream>
#include <stdexcept>

namespace VLN::Interop {

namespace {

template <class T> T const* property(Object const& object, char const* key, Ostil::Any& holder) {
  holder = object.getProperty(key);
  return holder.get<T>();
}

void readMetadata(std::string const& bytes, openvdb::MetaMap& into) {
  std::istringstream in(bytes, std::ios::binary);
  try {
    into.readMeta(in);
  } catch (std::exception const&) { throw std::runtime_error("stored metadata cannot be read"); }
}

openvdb::GridBase::Ptr toGrid(Object const& object, VdbGridRecord const& record) {
  auto const container = object.component<VdbContainer>(kVdbContainerName);
  auto const channel = object.component<TileTree3D::ChannelBase>(record.channel);
  auto const state = object.component<StateChannel>(record.stateChannel);
  bool const complete = container && channel && (record.rule != VdbActiveRule::kChannel || state);
  auto grid = complete ? makeGrid(record.type, {*container, *channel, state.get(), record.rule}) : nullptr;
  if (!grid)
    throw std::runtime_error("the volume no longer holds the grid '" + record.channel + "' as it came");
  readMetadata(record.metadata, *grid);
  return grid;
}

} // namespace

void exportVdb(std::vector<VdbVolume> const& volumes, std::string const& path, Progress const& progress) {
  openvdb::initialize();
  OutputFile out(path);
  openvdb::GridPtrVec grids;
  openvdb::MetaMap metadata;
  std::size_t count = 0, done = 0;
  Ostil::Any holder, bytesHolder;
  for (auto const& volume : volumes) count += volume.channels.size();
  for (auto const& volume : volumes) {
    auto const* records = property<Ostil::Array<VdbGridRecord>>(*volume.object, kVdbGridsProperty, holder);
    if (!records) continue;
    auto const* transform = property<Ostil::String>(*volume.object, kVdbTransformProperty, bytesHolder);
    IndexToWorld const indexToWorld = transform ? IndexToWorld(*transform) : IndexToWorld();
    for (auto const& record : *records) {
      if (progress)
        progress("building the grids", 0.8 * double(done++) / double(std::max<std::size_t>(1, count)));
      auto grid = toGrid(*volume.object, record);
      grid->setTransform(indexToWorld.impl().transform->copy());
      grids.push_back(grid);
    }
    if (auto const* bytes = property<Ostil::String>(*volume.object, kVdbMetadataProperty, bytesHolder))
      readMetadata(*bytes, metadata);
  }
  if (progress) progress("writing", 0.8);
  writeVdbFile(out, grids, metadata);
  if (progress) progress("done", 1);
}

} // namespace VLN::Interop
