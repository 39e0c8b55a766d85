#include "Interop/PointVolume.h"
#include "Interop/FreeNameImpl.h"

#include "GeometryVolume/channels/ElementReTile.h"
#include "GeometryVolume/core/Numeric.h"
#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/core/ScopedExtraction.h"
#include "GeometryVolume/tiletree/Morton.h"
#include "GeometryVolume/topology/Command.h"

#include <cmath>
#include <set>

namespace VLN::Interop {

namespace {

using TileTree3D::TreeIndex;
using Velorn::Math::float3;
using Velorn::Math::int3;
namespace Command = TileTree3D::Command;

constexpr int kDeepest = PointTraits::kMaxDepth;

/// The deepest depth at which the box is at most 64 tiles wide on each axis.
int rootDepthOf(Velorn::Math::bbox<int3, int> const& box) {
  for (int d = kDeepest; d > 0; --d) {
    bool fits = true;
    for (int a = 0; a < 3; ++a) {
      auto const tiles = [&](int c) {
        return std::int64_t(PointTraits::align(c, d)) / PointTraits::width(d);
      };
      fits &= tiles(box.max[a]) - tiles(box.min[a]) < 64;
    }
    if (fits) return d;
  }
  return 0;
}

/// Which points lie in each tile of the deepest depth: tile t holds order[starts[t]..starts[t + 1]).
struct Placement {
  std::vector<std::int64_t> order;
  std::vector<std::size_t> starts;
  PointContainer::TileLists corners;
  std::int64_t dropped = 0;
};

Placement placePoints(std::vector<float3> const& positions) {
  // Re-tiling drops what is out of this reach.
  constexpr float kReach = 536870912.0f;
  std::vector<int3> tiles(positions.size());
  std::vector<SortRecord> records;
  records.reserve(positions.size());
  Placement result;
  Velorn::Math::bbox<int3, int> box;
  for (std::size_t n = 0; n < positions.size(); ++n) {
    float3 const& p = positions[n];
    if (!(std::abs(p.x) < kReach && std::abs(p.y) < kReach && std::abs(p.z) < kReach)) {
      ++result.dropped;
      continue;
    }
    auto const corner = [&](float c) { return PointTraits::align(toIntFloor(c), kDeepest); };
    tiles[n] = {corner(p.x), corner(p.y), corner(p.z)};
    box.grow(tiles[n]);
    records.push_back(TileTree3D::mortonRecord<PointTraits>(tiles[n], static_cast<std::int64_t>(n)));
  }
  parallelSort(records.data(), static_cast<std::int64_t>(records.size()));
  auto& deepest = result.corners[kDeepest];
  for (auto const& record : records) {
    int3 const& tile = tiles[record.value];
    if (deepest.empty() || deepest.back() != tile) {
      deepest.append(tile);
      result.starts.push_back(result.order.size());
    }
    result.order.push_back(record.value);
  }
  result.starts.push_back(result.order.size());
  if (box.empty()) return result;
  // The roots; what lies between comes with the bulk addition.
  int const top = rootDepthOf(box);
  auto& roots = result.corners[top];
  for (std::size_t n = 0; top < kDeepest && n < deepest.size(); ++n) {
    int3 const& p = deepest[n];
    int3 const root{PointTraits::align(p.x, top), PointTraits::align(p.y, top), PointTraits::align(p.z, top)};
    if (roots.empty() || roots.back() != root) roots.append(root);
  }
  return result;
}

/// Fills each tile with its points' values, taken from `values`.
template <class T, class Values>
void fillTiles(TileTree3D::Channel<PointTraits, T, 4, 0>& channel, std::vector<TreeIndex> const& tiles,
               Placement const& placement, Values const& values) {
  parallelFor(0, static_cast<std::int64_t>(tiles.size()),
              [&](std::int64_t begin, std::int64_t end) {
                for (auto t = begin; t < end; ++t) {
                  std::size_t const first = placement.starts[t], last = placement.starts[t + 1];
                  auto data = channel.tileDataAccessor().tileData(tiles[t]);
                  data.resize(static_cast<int>(last - first), T{});
                  for (std::size_t n = first; n < last; ++n)
                    data[static_cast<int>(n - first)] = values(static_cast<std::size_t>(placement.order[n]));
                }
              },
              {.grain = 64});
}

} // namespace

PointVolume buildPointVolume(PointSet const& points) {
  PointVolume volume;
  volume.origin = points.origin;
  volume.voxelSize = points.voxelSize;
  volume.doublePositions = points.doublePositions;
  Placement const placement = placePoints(points.positions);
  volume.dropped = placement.dropped;

  auto container = Command::createContainer<2, 4, 0>(kPointContainerName, 1.0f);
  container->tileAccessor().addTiles(placement.corners);
  std::vector<TreeIndex> tiles;
  auto const find = container->tileAccessor();
  for (int3 const& corner : placement.corners[kDeepest])
    tiles.push_back(find.treeIndex(corner.x, corner.y, corner.z, kDeepest, true));

  auto object = createEmptyVLN();
  auto shared = Command::createPointTopology<2, 4, 0>(kPointTopologyName, *container, *object);
  shared = nullptr;
  auto topology = object->extractComponent<PointTopology>(kPointTopologyName);
  auto positions = Command::createChannel<float3, 2, 4, 4, 0, 0>(
      kPositionsName, *topology, *object, float3{0, 0, 0}, TileTree3D::kInitializeDefaultValue, 0, kDeepest);
  fillTiles(*positions, tiles, placement, [&](std::size_t n) { return points.positions[n]; });
  topology->update(*positions);

  std::set<std::string> taken{kPointContainerName, kPointTopologyName, kPositionsName};
  for (PointAttribute const& attribute : points.attributes) {
    bool const known = withElementType(attribute.type, [&]<class T>() {
      std::string const name = freeName(attribute.name, taken);
      auto channel = Command::createChannel<T, 2, 4, 4, 0, 0>(
          name, *topology, *object, T{}, TileTree3D::kInitializeDefaultValue, 0, kDeepest);
      fillTiles(*channel, tiles, placement, [&](std::size_t n) { return attribute.value<T>(n); });
      volume.attributes.emplace_back(attribute.name, name);
    });
    if (!known) volume.skippedAttributes.push_back(attribute.name);
  }
  object->putComponent(std::move(topology));
  object->addComponent(container);
  volume.object = std::move(object);
  return volume;
}

PointSet pointSetOf(PointVolume const& volume) {
  PointSet points;
  points.origin = volume.origin;
  points.voxelSize = volume.voxelSize;
  points.doublePositions = volume.doublePositions;
  auto const positions = volume.object->component<PositionChannel>(kPositionsName);
  points.positions.assign(std::as_const(*positions).cbegin(), std::as_const(*positions).cend());
  for (auto const& [name, channelName] : volume.attributes) {
    auto const component = volume.object->component(channelName);
#define VLN_TRY_TYPE(type_, name_)                                                                           \
  if (auto const* channel =                                                                                  \
          dynamic_cast<TileTree3D::Channel<PointTraits, type_, 4, 0> const*>(component.get())) {             \
    points.attributes.push_back(makeAttribute<type_>(name));                                                 \
    for (type_ const& v : *channel) points.attributes.back().append(v);                                      \
    continue;                                                                                                \
  }
    VLN_FOR_EACH_ELEMENT_TYPE(VLN_TRY_TYPE)
#undef VLN_TRY_TYPE
  }
  return points;
}

AdvectStatistics advect(PointVolume& volume, Velorn::Math::double3 const& velocity) {
  Object& object = *volume.object;
  // They come back whatever is thrown.
  VLN::Internal::ScopedExtraction<PointContainer> const takenTree(object, kPointContainerName);
  VLN::Internal::ScopedExtraction<PointTopology> const takenTopology(object, kPointTopologyName);
  VLN::Internal::ScopedExtraction<PositionChannel> const takenPositions(object, kPositionsName);
  auto* const tree = &*takenTree;
  auto* const topology = &*takenTopology;
  auto* const positions = &*takenPositions;
  auto const step = velocity * (1 / volume.voxelSize);
  positions->cloneData();
  for (int d = 0; d <= kDeepest; ++d) {
    parallelFor(0, positions->tileCount(d),
                [&](std::int64_t begin, std::int64_t end) {
                  for (std::int64_t n = begin; n < end; ++n) {
                    for (float3& p : positions->tileData(n, d)) {
                      for (int a = 0; a < 3; ++a) p[a] = static_cast<float>(double(p[a]) + step[a]);
                    }
                  }
                },
                {.grain = 256});
  }
  AdvectStatistics statistics;
  std::int64_t const before = tree->tileCount(-1);
  std::int64_t grown = before;
  TileTree3D::channelElementReTile(*tree, *topology, *positions, object, true,
                                   [&](TileTree3D::TileRemovalList const* removed) {
                                     if (!removed) grown = tree->tileCount(-1);
                                   });
  statistics.tilesGained = grown - before;
  statistics.tilesLost = grown - tree->tileCount(-1);
  return statistics;
}

} // namespace VLN::Interop
