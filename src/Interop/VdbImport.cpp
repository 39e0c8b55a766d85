#include "Interop/VdbImport.h"

#include "GeometryVolume/channels/Channel.h"
#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/tiletree/Container.h"
#include "GeometryVolume/topology/Command.h"
#include "GeometryVolume/topology/VoxelTopology.h"
#include "GeometryVolume/utils/ChannelParser.h"
#include "Interop/FileError.h"
#include "Interop/FreeNameImpl.h"
#include "Interop/IndexToWorldImpl.h"
#include "Interop/VdbImportImpl.h"
#include "Interop/VdbMaskImpl.h"
#include "Interop/VdbRecord.h"

#include <algorithm>
#include <cmath>
#include <set>
#include <sstream>

namespace VLN::Interop {

namespace {

using Velorn::Math::int3;
using Container = VdbContainer;
using Topology = VdbTopology;

// Grids that share a transform, and so an object.
struct Group {
  std::string transform; ///< as transformBytes() writes it
  std::vector<std::unique_ptr<GridSource>> grids;
  std::vector<std::string> types; ///< of the values in the file
  std::vector<GridSummary> summaries;
};

// Shares of the whole work, for the progress: measured on large files.
constexpr double kReadDone = 0.4, kTreeDone = 0.6;

void report(Progress const& progress, char const* stage, double done) {
  if (progress) progress(stage, done);
}

// Why a transform cannot be kept, such as a singular matrix out of a damaged file; empty when it can.
std::string whyNotKept(openvdb::math::Transform const& transform) {
  try {
    IndexToWorld const kept(transformBytes(transform));
    kept.besidesScale();
    kept.toIndex(kept.toWorld({1, 1, 1}));
    return {};
  } catch (std::exception const& error) { return "its transform cannot be used: " + oneLine(error.what()); }
}

struct TypedSource {
  std::unique_ptr<GridSource> source; ///< null for a type that is not supported
  std::string type;
};

/// A source for each grid of a file.
std::vector<TypedSource> makeSources(VdbFile const& file) {
  std::vector<TypedSource> sources(file.grids.size());
  // Sources number the leaves of trees, which grids may share unless their voxels are packed.
  bool const apart = file.packed.size() == file.grids.size();
  auto const count = std::int64_t(sources.size());
  parallelFor(0, count,
              [&](std::int64_t first, std::int64_t last) {
                for (auto n = static_cast<std::size_t>(first); n < static_cast<std::size_t>(last); ++n) {
                  auto const& base = file.grids[n];
                  auto const packed = file.packed.find(base.get());
                  sources[n].source = makeGridSource(
                      {withoutMask(base), packed == file.packed.end() ? nullptr : packed->second},
                      sources[n].type);
                }
              },
              {.grain = apart ? 1 : std::max<std::int64_t>(1, count)});
  return sources;
}

/// Takes the grids out of the file, apart from those of points.
std::vector<Group> groupByTransform(VdbFile& file, std::vector<SkippedGrid>& skipped) {
  std::vector<Group> groups;
  std::vector<TypedSource> sources = makeSources(file);
  for (std::size_t n = 0; n < sources.size(); ++n) {
    auto const& base = file.grids[n];
    auto& [source, type] = sources[n];
    if (!source) {
      if (isPointGrid(*base)) continue;
      skipped.push_back({base->getName(), "grids of type " + oneLine(type) + " are not read"});
      continue;
    }
    if (auto const reason = source->whyNotPlaced()) {
      skipped.push_back({base->getName(), *reason});
      continue;
    }
    if (std::string const reason = whyNotKept(base->transform()); !reason.empty()) {
      skipped.push_back({base->getName(), reason});
      continue;
    }
    // OpenVDB's comparison lets transforms pass that differ a little; what comes back is to be the same.
    std::string const bytes = transformBytes(base->transform());
    auto group =
        std::find_if(groups.begin(), groups.end(), [&](Group const& g) { return g.transform == bytes; });
    if (group == groups.end()) {
      groups.push_back({bytes, {}, {}, {}});
      group = groups.end() - 1;
    }
    group->types.push_back(valueTypeOf(*base));
    group->grids.push_back(std::move(source));
  }
  std::erase_if(file.grids, [](auto const& grid) { return !isPointGrid(*grid); });
  file.packed.clear();
  return groups;
}

void addTiles(Container& container, TileCorners const& corners) {
  Container::TileLists lists;
  for (std::size_t depth = 0; depth < corners.size(); ++depth)
    for (int3 const& corner : corners[depth]) lists[depth].append(corner);
  container.tileAccessor().addTiles(lists);
}

template <class F> void forEachGrid(Group const& group, F const& f) {
  parallelFor(0, std::int64_t(group.grids.size()), [&](std::int64_t first, std::int64_t last) {
    for (std::int64_t n = first; n < last; ++n) f(static_cast<std::size_t>(n));
  });
}

std::size_t countOf(TileCorners const& corners) {
  std::size_t count = 0;
  for (auto const& list : corners) count += list.size();
  return count;
}

void addRootsBeyond(std::vector<int3>& roots, Group const& group, int depth) {
  RootPlaces const known(roots, depth);
  std::vector<std::vector<int3>> beyond(group.grids.size());
  forEachGrid(group, [&](std::size_t n) { group.grids[n]->collectBeyondRoots(known, beyond[n]); });
  std::vector<int3> all;
  for (auto const& part : beyond) all.insert(all.end(), part.begin(), part.end());
  if (!all.empty()) addSorted(roots, std::move(all));
}

/// The tiles that the grids need in all, without ancestors.
TileCorners collectTiles(Group const& group, int rootDepth, std::uint64_t mostTiles) {
  std::vector<NeededTiles> needed(group.grids.size());
  forEachGrid(group, [&](std::size_t n) { needed[n] = group.grids[n]->collectTiles(rootDepth, mostTiles); });
  std::uint64_t count = 0;
  for (NeededTiles const& tiles : needed) count += tiles.count;
  BlockList blocks;
  if (count > mostTiles) {
    // Where memory is short, those come first that the grids before have.
    for (std::size_t n = 0; n < needed.size(); ++n) {
      std::uint64_t const known = countBlocks(blocks);
      needed[n] = group.grids[n]->collectTiles(rootDepth, mostTiles - std::min(mostTiles, known));
      blocks = unionOf(blocks, std::exchange(needed[n].blocks, {}));
    }
  } else {
    // By pairs: grids are much the same.
    for (std::size_t step = 1; step < needed.size(); step *= 2)
      for (std::size_t n = 0; n + step < needed.size(); n += 2 * step)
        needed[n].blocks = unionOf(needed[n].blocks, std::exchange(needed[n + step].blocks, {}));
    if (!needed.empty()) blocks.swap(needed[0].blocks);
  }
  TileCorners corners;
  for (NeededTiles const& tiles : needed)
    for (int depth = 0; depth < VdbTraits::kDepths; ++depth)
      corners[depth].insert(corners[depth].end(), tiles.wider[depth].begin(), tiles.wider[depth].end());
  corners[VdbTraits::kMaxDepth] = cornersOf(blocks);
  if (rootDepth < VdbTraits::kMaxDepth)
    for (PlaceBlocks const& b : blocks) corners[VdbTraits::kMaxDepth - 1].push_back(b.place);
  return corners;
}

// About what a volume takes: records of tiles and of their vectors, child tables and samples. Many grids that
// lie apart share one large tree, so a small file can ask for much.
std::uint64_t bytesFor(std::size_t tiles, Group const& group) {
  std::uint64_t bytesPerTile = 160;
  for (auto const& grid : group.grids)
    bytesPerTile += VdbTraits::kTileDataSize * (grid->bytesPerSample() + 1) + 2 * 64;
  return tiles * bytesPerTile;
}

void checkMemory(VdbFile const& file, std::uint64_t bytes, std::uint64_t memoryLeft) {
  if (bytes > memoryLeft)
    throw FileError(file.path, "its volumes need more than " + std::to_string(file.memoryBytes / 1000000) +
                                   " MB of memory");
}

std::string metadataBytes(openvdb::MetaMap const& metadata) {
  std::ostringstream out(std::ios::binary);
  metadata.writeMeta(out);
  return out.str();
}

// Tells of each grid in the volume.
// @return What the way back needs.
Ostil::Array<VdbGridRecord> tellOfGrids(Group const& group, VdbVolume& volume) {
  // Components and plain properties share one set of names. Grids come first to their names, channels of
  // states after them.
  std::set<std::string> taken{kVdbContainerName, kVdbTopologyName, kVdbGridsProperty, kVdbTransformProperty,
                              kVdbMetadataProperty};
  std::vector<std::string> names;
  for (auto const& source : group.grids) names.push_back(freeName(source->grid().getName(), taken));
  Ostil::Array<VdbGridRecord> records;
  for (std::size_t n = 0; n < group.grids.size(); ++n) {
    GridSource const& source = *group.grids[n];
    GridSummary const& summary = group.summaries[n];
    VdbGridRecord record{names[n], group.types[n], source.activeRule(), "", metadataBytes(source.grid()), {}};
    for (int3 const& voxel : source.alsoActive()) record.alsoActive.append(voxel);
    if (record.rule == VdbActiveRule::kChannel) record.stateChannel = freeName(names[n] + "_active", taken);
    records.append(record);
    volume.channels.push_back({names[n], source.grid().getName(), group.types[n], 4, 0, summary.activeVoxels,
                               summary.minimum, summary.maximum, summary.hasRange, summary.active});
    if (!summary.active.empty())
      volume.activeBox.grow(summary.active.min), volume.activeBox.grow(summary.active.max);
  }
  return records;
}

struct GridChannels {
  Ostil::Ptr<TileTree3D::ChannelBase> values;
  Ostil::Ptr<StateChannel> states; ///< null unless the rule is kChannel
};

// Makes and fills the channels of a volume. Each grid goes when its channels are there: what it took is at
// hand for the next ones.
void addChannels(Group& group, Ostil::Array<VdbGridRecord> const& records, VLN::Object& object,
                 TreeToFill const& tree, VLN::FunctionRef<void(double share)> filledShare) {
  auto const count = std::int64_t(group.grids.size()), tiles = tree.container.tileCount(-1);
  auto const make = [&](std::int64_t n, FilledTiles filled) {
    auto& source = group.grids[n];
    VdbGridRecord const& record = records[n];
    GridChannels made{source->makeChannel(record.channel, tree, filled), nullptr};
    if (record.rule == VdbActiveRule::kChannel)
      made.states = source->makeStateChannel(record.stateChannel, tree);
    source.reset();
    return made;
  };
  double filled = 0;
  auto const reportProgress = [&](std::int64_t more) {
    filled += double(more);
    filledShare(filled / (double(tiles) * double(count)));
  };
  // Of a small tree several at once, so that no core waits for others at the end of each depth. Of a large
  // one there is something to tell before a grid ends.
  constexpr std::int64_t kSmall = 1 << 16, kAtOnce = 8;
  std::int64_t const atOnce = tiles < kSmall ? kAtOnce : 1;
  for (std::int64_t first = 0; first < count; first += atOnce) {
    std::int64_t const last = std::min(first + atOnce, count);
    std::vector<GridChannels> made(last - first);
    if (made.size() == 1) {
      made[0] = make(first, reportProgress);
    } else {
      parallelFor(first, last, [&](std::int64_t begin, std::int64_t end) {
        for (std::int64_t n = begin; n < end; ++n) made[n - first] = make(n, [](std::int64_t) {});
      });
      reportProgress(tiles * (last - first));
    }
    for (GridChannels& channels : made) {
      object.addComponent(std::move(channels.values));
      if (channels.states) object.addComponent(std::move(channels.states));
    }
  }
}

// `memoryLeft` falls by what the volume takes.
VdbVolume buildVolume(VdbFile const& file, Group& group, std::uint64_t& memoryLeft, Progress const& progress,
                      double from, double to) {
  report(progress, "building the tree", from);
  int root = rootDepth(group.summaries);
  if (root < VdbTraits::kMaxDepth) {
    std::vector<int3> leaves, wideTiles;
    for (auto const& grid : group.grids) grid->collectStored(leaves, wideTiles);
    root = cheapestRootDepth(std::move(leaves), std::move(wideTiles), root);
  }
  // A half for the shells of wide tiles: ancestors take an eighth or more, and lists of corners their part.
  std::uint64_t const mostTiles = memoryLeft / 2 / bytesFor(1, group);
  TileCorners corners = collectTiles(group, root, mostTiles);
  completeCorners(corners, root);
  addRootsBeyond(corners[root], group, root);
  std::uint64_t const bytes = bytesFor(countOf(corners), group);
  checkMemory(file, bytes, memoryLeft);
  memoryLeft -= bytes;
  VdbVolume volume;
  volume.indexToWorld = IndexToWorld(group.transform);
  volume.transform = volume.indexToWorld.besidesScale();
  double const size = volume.indexToWorld.voxelSize().x;
  auto const sizeInFloat = static_cast<float>(size);
  if (sizeInFloat > 0 && std::isfinite(sizeInFloat)) volume.voxelSize = size;

  auto object = TileTree3D::Command::createVoxelVLN<VdbTraits>(kVdbContainerName, kVdbTopologyName,
                                                               static_cast<float>(volume.voxelSize),
                                                               TileTree3D::kVoxelOffsetCorner);
  auto container = object->extractComponent<Container>(kVdbContainerName);
  addTiles(*container, corners);
  auto topology = object->extractComponent<Topology>(kVdbTopologyName);
  topology->update(*container);

  Ostil::Array<VdbGridRecord> const records = tellOfGrids(group, volume);
  addChannels(group, records, *object, {*container, *topology, tilesFollowLeaves(*container)},
              [&](double share) { report(progress, "filling the channels", from + (to - from) * share); });
  object->setProperty(kVdbGridsProperty, Ostil::Any(records));
  object->setProperty(kVdbTransformProperty, Ostil::Any(Ostil::String(volume.indexToWorld.bytes())));
  if (file.metadata)
    object->setProperty(kVdbMetadataProperty, Ostil::Any(Ostil::String(metadataBytes(*file.metadata))));
  object->putComponent(std::move(topology));
  object->putComponent(std::move(container));
  volume.object = std::move(object);
  return volume;
}

} // namespace

VdbChannel const* VdbVolume::channel(std::string const& name) const {
  for (VdbChannel const& c : channels)
    if (c.name == name) return &c;
  return nullptr;
}

std::string transformBesidesScale(openvdb::math::Transform const& transform) {
  std::string const type = oneLine(transform.mapType());
  if (!transform.isLinear()) return "not linear (" + type + ")";
  openvdb::math::Mat4d const m = transform.baseMap()->getAffineMap()->getMat4();
  double const scale = m(0, 0);
  bool uniform = scale > 0 && std::isfinite(static_cast<float>(scale)) && static_cast<float>(scale) > 0;
  bool translated = false;
  for (int row = 0; row < 4; ++row)
    for (int column = 0; column < 4; ++column) {
      double const expected = row == column ? (row == 3 ? 1 : scale) : 0;
      if (m(row, column) == expected) continue;
      // Row vectors: the last row is the translation.
      if (row == 3 && column < 3)
        translated = true;
      else
        uniform = false;
    }
  if (!uniform) return "not one uniform scale along the axes (" + type + ")";
  return translated ? "a uniform scale with a translation" : "";
}

namespace {

VdbImport importAndDrop(VdbFile& file, Progress const& progress) {
  VdbImport result;
  result.file = file.path;
  result.skipped = file.skipped;
  if (file.metadata) result.metadata = metadataBytes(*file.metadata);
  report(progress, "looking through the grids", kReadDone);
  auto groups = groupByTransform(file, result.skipped);
  for (Group& group : groups)
    for (auto const& grid : group.grids) group.summaries.push_back(grid->summarize());
  std::uint64_t memoryLeft = file.memoryBytes > 0 ? file.memoryBytes : ~std::uint64_t(0);
  for (std::size_t n = 0; n < groups.size(); ++n) {
    double const share = (1 - kTreeDone) / double(groups.size());
    result.volumes.push_back(buildVolume(file, groups[n], memoryLeft, progress, kTreeDone + share * double(n),
                                         kTreeDone + share * double(n + 1)));
  }
  result.points = importPointGrids(file, result.skipped);
  report(progress, "done", 1);
  return result;
}

} // namespace

VdbImport importGrids(VdbFile const& file, Progress const& progress) {
  VdbFile shared = file;
  return importAndDrop(shared, progress);
}

VdbImport importGrids(VdbFile& file, VdbReadLimits const& limits, Progress const& progress) {
  if (!limits.channels.empty()) {
    Utils::ChannelParser filter;
    if (auto const status = filter.parses(limits.channels); !status)
      throw FileError(file.path,
                      "the filter '" + oneLine(limits.channels, 60) + "' is none: " + status.message);
    std::erase_if(file.grids, [&](auto const& grid) {
      return !filter.accepts(grid->getName().empty() ? "unnamed" : grid->getName());
    });
  }
  return importAndDrop(file, progress);
}

VdbImport importVdb(std::string const& path, VdbReadLimits const& limits, Progress const& progress) {
  report(progress, "reading", 0);
  VdbFile file = readVdbFile(
      path, limits, [&](double share) { report(progress, "reading", kReadDone * share); },
      LeafMemory::kPacked);
  return importGrids(file, limits, progress);
}

} // namespace VLN::Interop
