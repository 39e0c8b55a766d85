#include "Interop/VdbExport.h"

#include "GeometryVolume/pools/Jemalloc.h"
#include "Interop/IndexToWorldImpl.h"
#include "Interop/VdbExportImpl.h"
#include "Interop/VdbGridMakeImpl.h"
#include "Interop/VdbMaskImpl.h"
#include "Interop/VdbRecord.h"
#include "Interop/VdbWriteImpl.h"

#include <algorithm>
#include <sstream>
#include <stdexcept>
#include <utility>

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

/// @param release Whether the channels of the grid go meanwhile.
openvdb::GridBase::Ptr toGrid(Object& object, VdbGridRecord const& record, bool release) {
  using TileTree3D::ChannelBase;
  auto const container = object.component<VdbContainer>(kVdbContainerName);
  Ostil::MutablePtr<ChannelBase> released;
  Ostil::Ptr<ChannelBase> kept;
  if (release)
    released = object.extractComponent<ChannelBase>(record.channel);
  else
    kept = object.component<ChannelBase>(record.channel);
  ChannelBase const* const channel = release ? released.get() : kept.get();
  auto const state = object.component<StateChannel>(record.stateChannel);
  if (release && state) object.removeComponent(record.stateChannel);
  bool const complete = container && channel && (record.rule != VdbActiveRule::kChannel || state);
  bool const mask = record.type == kMaskType;
  auto grid = complete ? makeGrid(mask ? Ostil::String("bool") : record.type,
                                  {*container,
                                   *channel,
                                   state.get(),
                                   record.rule,
                                   {record.alsoActive.data(), record.alsoActive.size()},
                                   released.get()})
                       : nullptr;
  if (grid && mask) grid = maskOf(*grid);
  if (!grid)
    throw std::runtime_error("the volume no longer holds the grid '" + record.channel + "' as it came");
  readMetadata(record.metadata, *grid);
  return grid;
}

// The grids of volumes in the order of their records.
class ExportedGrids {
public:
  /// @param release Whether grids take their channels along. Then nobody else has the volumes' objects.
  /// @param metadata Takes that of the volumes.
  ExportedGrids(std::vector<VdbVolume> const& volumes, bool release, openvdb::MetaMap& metadata,
                Progress const& progress)
      : m_progress(progress)
      , m_release(release) {
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
  openvdb::GridBase::Ptr make(std::size_t n) {
    if (m_progress)
      m_progress("building the grids", 0.8 * double(n) / double(std::max<std::size_t>(1, m_count)));
    auto& [object, record] = m_grids[n];
    auto grid = toGrid(*object, record, m_release);
    Ostil::Any holder;
    auto const* transform = property<Ostil::String>(*object, kVdbTransformProperty, holder);
    IndexToWorld const indexToWorld = transform ? IndexToWorld(*transform) : IndexToWorld();
    grid->setTransform(indexToWorld.impl().transform->copy());
    if (m_release) {
      // With the last of its grids the volume.
      object.reset();
      jemalloc_purge();
    }
    return grid;
  }

private:
  struct Grid {
    Ostil::Ptr<Object> object;
    VdbGridRecord record;
  };
  Progress const& m_progress;
  bool m_release;
  std::size_t m_count = 0;
  std::vector<Grid> m_grids;
};

void write(std::vector<VdbVolume> volumes, bool release, std::vector<PointVolume> const& points,
           std::string const& fileMetadata, std::string const& path, Progress const& progress) {
  openvdb::initialize();
  OutputFile out(path);
  openvdb::MetaMap metadata;
  if (!fileMetadata.empty()) readMetadata(fileMetadata, metadata);
  ExportedGrids exported(volumes, release, metadata, progress);
  volumes.clear();
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
  ExportedGrids exported(content.volumes, false, metadata, progress);
  openvdb::GridPtrVec grids;
  for (std::size_t n = 0; n < exported.size(); ++n) grids.push_back(exported.make(n));
  return grids;
}

void exportVdb(std::vector<VdbVolume> const& volumes, std::string const& path, Progress const& progress) {
  write(volumes, false, {}, "", path, progress);
}

void exportVdb(VdbImport const& content, std::string const& path, Progress const& progress) {
  write(content.volumes, false, content.points, content.metadata, path, progress);
}

void exportVdbReleasing(VdbImport& content, std::string const& path, Progress const& progress) {
  write(std::exchange(content.volumes, {}), true, content.points, content.metadata, path, progress);
}

} // namespace VLN::Interop
