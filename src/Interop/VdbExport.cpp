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
                                  {*container,
                                   *channel,
                                   state.get(),
                                   record.rule,
                                   {record.alsoActive.data(), record.alsoActive.size()}})
                       : nullptr;
  if (grid && mask) grid = maskOf(*grid);
  if (!grid)
    throw std::runtime_error("the volume no longer holds the grid '" + record.channel + "' as it came");
  readMetadata(record.metadata, *grid);
  return grid;
}

// The grids of volumes, which must stay, in the order of their records.
class ExportedGrids {
public:
  /// @param metadata Takes that of the volumes.
  ExportedGrids(std::vector<VdbVolume> const& volumes, openvdb::MetaMap& metadata, Progress const& progress)
      : m_progress(progress) {
    for (auto const& volume : volumes) {
      m_count += volume.channels.size();
      Ostil::Any holder;
      auto const* records = property<Ostil::Array<VdbGridRecord>>(*volume.object, kVdbGridsProperty, holder);
      if (!records) continue;
      for (auto const& record : *records) m_grids.push_back({volume.object, record});
      if (auto const* bytes = property<Ostil::String>(*volume.object, kVdbMetadataProperty, holder))
        readMetadata(*bytes, metadata);
    }
  }

  std::size_t size() const { return m_grids.size(); }
  std::string nameOf(std::size_t n) const {
    openvdb::MetaMap metadata;
    readMetadata(m_grids[n].record.metadata, metadata);
    auto const name = metadata[openvdb::GridBase::META_GRID_NAME];
    return name ? name->str() : std::string();
  }
  openvdb::GridBase::Ptr make(std::size_t n) const {
    if (m_progress)
      m_progress("building the grids", 0.8 * double(n) / double(std::max<std::size_t>(1, m_count)));
    auto const& [object, record] = m_grids[n];
    auto grid = toGrid(*object, record);
    Ostil::Any holder;
    auto const* transform = property<Ostil::String>(*object, kVdbTransformProperty, holder);
    IndexToWorld const indexToWorld = transform ? IndexToWorld(*transform) : IndexToWorld();
    grid->setTransform(indexToWorld.impl().transform->copy());
    return grid;
  }

private:
  struct Grid {
    Ostil::Ptr<Object> object;
    VdbGridRecord record;
  };
  Progress const& m_progress;
  std::size_t m_count = 0;
  std::vector<Grid> m_grids;
};

void write(std::vector<VdbVolume> const& volumes, std::vector<PointVolume> const& points,
           std::string const& fileMetadata, std::string const& path, Progress const& progress) {
  openvdb::initialize();
  OutputFile out(path);
  openvdb::MetaMap metadata;
  if (!fileMetadata.empty()) readMetadata(fileMetadata, metadata);
  ExportedGrids const exported(volumes, metadata, progress);
  std::vector<GridInTurn> grids;
  for (std::size_t n = 0; n < exported.size(); ++n)
    grids.push_back({exported.nameOf(n), [&exported, n] { return exported.make(n); }});
  for (auto const& volume : points) {
    std::string const name = volume.name.empty() ? "points" : volume.name;
    grids.push_back({name, [&volume, name] { return makePointsGrid(pointSetOf(volume), name); }});
  }
  writeVdbFile(out, grids, metadata, [&] {
    if (progress) progress("writing", 0.8);
  });
  if (progress) progress("done", 1);
}

} // namespace

openvdb::GridPtrVec exportedGrids(VdbImport const& content, Progress const& progress) {
  openvdb::initialize();
  openvdb::MetaMap metadata;
  ExportedGrids const exported(content.volumes, metadata, progress);
  openvdb::GridPtrVec grids;
  for (std::size_t n = 0; n < exported.size(); ++n) grids.push_back(exported.make(n));
  return grids;
}

void exportVdb(std::vector<VdbVolume> const& volumes, std::string const& path, Progress const& progress) {
  write(volumes, {}, "", path, progress);
}

void exportVdb(VdbImport const& content, std::string const& path, Progress const& progress) {
  write(content.volumes, content.points, content.metadata, path, progress);
}

} // namespace VLN::Interop
