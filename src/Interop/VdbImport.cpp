#include "Interop/VdbImport.h"

#include "GeometryVolume/channels/Channel.h"
#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/tiletree/Container.h"
#include "GeometryVolume/topology/Command.h"
#include "GeometryVolume/topology/VoxelTopology.h"
#include "Interop/FileError.h"
#include "Interop/VdbImportImpl.h"

#include <algorithm>
#include <cmath>
#include <set>

namespace VLN::Interop {

namespace {

using openvdb::FloatGrid;
using TileTree3D::TreeIndex;
using Velorn::Math::int3;
using Container = TileTree3D::Container<VdbTraits>;
using Topology = TileTree3D::VoxelTopology<VdbTraits>;
using FloatChannel = TileTree3D::Channel<VdbTraits, float, 4, 0>;

// Grids that share a transform, and so an object.
struct Group {
  openvdb::math::Transform::ConstPtr transform;
  std::vector<FloatGrid::ConstPtr> grids;
  std::vector<GridSummary> summaries;
};

// Shares of the whole work, for the progress: measured on large files.
constexpr double kReadDone = 0.4, kTreeDone = 0.6;

void tell(Progress const& progress, char const* stage, double done) {
  if (progress) progress(stage, done);
}

std::string typeOf(openvdb::GridBase const& grid) {
  if (grid.type() == "Tree_ptdataidx32_5_4_3") return "points";
  return grid.valueType();
}

std::vector<Group> groupByTransform(VdbFile const& file, std::vector<SkippedGrid>& skipped) {
  std::vector<Group> groups;
  for (auto const& base : file.grids) {
    auto const grid = openvdb::gridConstPtrCast<FloatGrid>(base);
    if (!grid) {
      skipped.push_back({base->getName(), "grids of type " + typeOf(*base) + " are not read yet"});
      continue;
    }
    if (auto const reason = whyNotPlaced(*grid)) {
      skipped.push_back({base->getName(), *reason});
      continue;
    }
    auto group = std::find_if(groups.begin(), groups.end(),
                              [&](Group const& g) { return *g.transform == grid->transform(); });
    if (group == groups.end()) {
      groups.push_back({grid->constTransformPtr(), {}, {}});
      group = groups.end() - 1;
    }
    group->grids.push_back(grid);
  }
  return groups;
}

// A name for each grid's channel that no other component of the object has.
std::string freeName(std::string const& wanted, std::set<std::string>& taken) {
  std::string const base = wanted.empty() ? "unnamed" : wanted;
  std::string name = base;
  for (int n = 2; !taken.insert(name).second; ++n) name = base + "_" + std::to_string(n);
  return name;
}

// The tree grows from the top down, so that no tile has to be made in passing.
void addTiles(Container& container, TileCorners const& corners) {
  auto accessor = container.tileAccessor();
  for (int depth = 0; depth <= VdbTraits::kMaxDepth; ++depth)
    for (int3 const& corner : corners[static_cast<std::size_t>(depth)]) accessor.addTile(corner, depth);
}

// Calls `done(tiles)` after each part.
template <class Done>
void fillChannel(FloatChannel& channel, Container const& container, FloatGrid const& grid, Done const& done) {
  constexpr std::int64_t kPart = 1 << 16;
  for (int depth = 0; depth <= VdbTraits::kMaxDepth; ++depth)
    for (std::int64_t first = 0; first < container.tileCount(depth); first += kPart) {
      std::int64_t const last = std::min(first + kPart, container.tileCount(depth));
      parallelFor(first, last,
                  [&](std::int64_t begin, std::int64_t end) {
                    auto accessor = grid.getConstAccessor();
                    for (std::int64_t n = begin; n < end; ++n) {
                      TreeIndex const at{n, depth};
                      fillTile(accessor, container.tile(at).tijk(), depth, &*channel.tileData(at).begin());
                    }
                  },
                  {.grain = 256});
      done(last - first);
    }
}

// About what a volume takes: records of tiles and of their vectors, child tables and samples. Many grids that
// lie apart share one large tree, so a small file can ask for much.
std::uint64_t bytesFor(TileCorners const& corners, std::size_t channels) {
  std::uint64_t tiles = 0;
  for (auto const& list : corners) tiles += list.size();
  return tiles * (160 + channels * (VdbTraits::kTileDataSize * sizeof(float) + 64));
}

// `memoryLeft` falls by what the volume takes.
VdbVolume buildVolume(VdbFile const& file, Group const& group, std::uint64_t& memoryLeft,
                      Progress const& progress, double from, double to) {
  tell(progress, "building the tree", from);
  TileCorners const corners = tileCorners(group.grids, rootDepth(group.summaries));
  if (std::uint64_t const bytes = bytesFor(corners, group.grids.size()); bytes <= memoryLeft)
    memoryLeft -= bytes;
  else
    throw FileError(file.path, "its volumes need more than " + std::to_string(file.memoryBytes / 1000000) +
                                   " MB of memory");
  VdbVolume volume;
  volume.transform = transformBesidesScale(*group.transform);
  double const size = group.transform->voxelSize().x();
  auto const sizeInFloat = static_cast<float>(size);
  if (sizeInFloat > 0 && std::isfinite(sizeInFloat)) volume.voxelSize = size;

  auto object = TileTree3D::Command::createVoxelVLN<VdbTraits>(kVdbContainerName, kVdbTopologyName,
                                                               static_cast<float>(volume.voxelSize),
                                                               TileTree3D::kVoxelOffsetCorner);
  auto container = object->extractComponent<Container>(kVdbContainerName);
  addTiles(*container, corners);
  auto topology = object->extractComponent<Topology>(kVdbTopologyName);
  topology->update(*container);

  std::set<std::string> taken{kVdbContainerName, kVdbTopologyName};
  double const tilesToFill = double(container->tileCount(-1)) * double(group.grids.size());
  double filled = 0;
  for (std::size_t n = 0; n < group.grids.size(); ++n) {
    FloatGrid const& grid = *group.grids[n];
    GridSummary const& summary = group.summaries[n];
    std::string const name = freeName(grid.getName(), taken);
    auto channel = TileTree3D::Command::createChannel<float, 2, 4, 4, 0, 0>(
        name, *topology, *object, grid.background(), TileTree3D::kInitializeNone, 0, VdbTraits::kMaxDepth);
    fillChannel(*channel, *container, grid, [&](std::int64_t tiles) {
      filled += double(tiles);
      tell(progress, "filling the channels", from + (to - from) * filled / tilesToFill);
    });
    volume.channels.push_back({name, grid.getName(), "float", 4, 0, summary.activeVoxels, summary.minimum,
                               summary.maximum, summary.hasRange, summary.active});
    if (!summary.active.empty())
      volume.activeBox.grow(summary.active.min), volume.activeBox.grow(summary.active.max);
  }
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

void fillTile(FloatGrid::ConstAccessor& grid, int3 const& corner, int depth, float* samples) {
  using Leaf = openvdb::FloatTree::LeafNodeType;
  int const step = VdbTraits::width(depth) / VdbTraits::kTDW;
  openvdb::Coord const origin(corner.x, corner.y, corner.z);
  if (step == 1) {
    // The tile lies in one leaf or in one tile of the file's tree.
    Leaf const* leaf = grid.probeConstLeaf(origin);
    if (!leaf) {
      std::fill(samples, samples + VdbTraits::kTileDataSize, grid.getValue(origin));
      return;
    }
    openvdb::Index const first = Leaf::coordToOffset(origin);
    for (openvdb::Index k = 0; k < 4; ++k)
      for (openvdb::Index j = 0; j < 4; ++j)
        for (openvdb::Index i = 0; i < 4; ++i) *samples++ = leaf->getValue(first + 64 * i + 8 * j + k);
    return;
  }
  for (int k = 0; k < 4; ++k)
    for (int j = 0; j < 4; ++j)
      for (int i = 0; i < 4; ++i) *samples++ = grid.getValue(origin.offsetBy(i * step, j * step, k * step));
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

VdbImport importGrids(VdbFile const& file, Progress const& progress) {
  VdbImport result;
  result.file = file.path;
  auto groups = groupByTransform(file, result.skipped);
  for (Group& group : groups)
    for (auto const& grid : group.grids) {
      tell(progress, "looking through the grids", kReadDone);
      group.summaries.push_back(summarize(*grid));
    }
  std::uint64_t memoryLeft = file.memoryBytes > 0 ? file.memoryBytes : ~std::uint64_t(0);
  for (std::size_t n = 0; n < groups.size(); ++n) {
    double const share = (1 - kTreeDone) / double(groups.size());
    result.volumes.push_back(buildVolume(file, groups[n], memoryLeft, progress, kTreeDone + share * double(n),
                                         kTreeDone + share * double(n + 1)));
  }
  tell(progress, "done", 1);
  return result;
}

VdbImport importVdb(std::string const& path, VdbReadLimits const& limits, Progress const& progress) {
  tell(progress, "reading", 0);
  VdbFile const file = readVdbFile(path, limits);
  return importGrids(file, progress);
}

} // namespace VLN::Interop
