#include "Interop/VdbExport.h"

#include "Interop/IndexToWorldImpl.h"
#include "Interop/VdbExportImpl.h"
#include "Interop/VdbGridMakeImpl.h"
#include "Interop/VdbMaskImpl.h"
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

openvdb::GridBase::Ptr makeGrid(std::string const& type, GridToWrite const& from) {
  auto grid = makeScalarGrid(type, from);
  return grid ? grid : makeVectorGrid(type, from);
}

openvdb::GridBase::Ptr toGrid(Object const& object, VdbGridRecord const& record) {
  auto const container = object.component<VdbContainer>(kVdbContainerName);
  auto const channel = object.component<TileTree3D::ChannelBase>(record.channel);
  auto const state = object.component<StateChannel>(record.stateChannel);
  bool const complete = container && channel && (record.rule != VdbActiveRule::kChannel || state);
  bool const mask = record.type == kMaskType;
  auto grid = complete ? makeGrid(mask ? Ostil::String("bool") : record.type,
                                  {*container, *channel, state.get(), record.rule})
                       : nullptr;
  if (grid && mask) grid = maskOf(*grid);
  if (!grid)
    throw std::runtime_error("the volume no longer holds the grid '" + record.channel + "' as it came");
  readMetadata(record.metadata, *grid);
  return grid;
}

// `metadata` takes that of the volumes.
openvdb::GridPtrVec makeGrids(std::vector<VdbVolume> const& volumes, openvdb::MetaMap& metadata,
                              Progress const& progress) {
  openvdb::GridPtrVec grids;
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
  return grids;
}

void write(std::vector<VdbVolume> const& volumes, std::vector<PointVolume> const& points,
           std::string const& fileMetadata, std::string const& path, Progress const& progress) {
  openvdb::initialize();
  OutputFile out(path);
  openvdb::MetaMap metadata;
  if (!fileMetadata.empty()) readMetadata(fileMetadata, metadata);
  openvdb::GridPtrVec grids = makeGrids(volumes, metadata, progress);
  for (auto const& volume : points)
    grids.push_back(makePointsGrid(pointSetOf(volume), volume.name.empty() ? "points" : volume.name));
  if (progress) progress("writing", 0.8);
  writeVdbFile(out, grids, metadata);
  if (progress) progress("done", 1);
}

} // namespace

openvdb::GridPtrVec exportedGrids(VdbImport const& content, Progress const& progress) {
  openvdb::initialize();
  openvdb::MetaMap metadata;
  return makeGrids(content.volumes, metadata, progress);
}

void exportVdb(std::vector<VdbVolume> const& volumes, std::string const& path, Progress const& progress) {
  write(volumes, {}, "", path, progress);
}

void exportVdb(VdbImport const& content, std::string const& path, Progress const& progress) {
  write(content.volumes, content.points, content.metadata, path, progress);
}

} // namespace VLN::Interop
