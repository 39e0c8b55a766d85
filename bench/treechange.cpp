// Changing trees and moving points, beside OpenVDB on the same voxels and points in the same run.
#include "GeometryVolume/channels/ElementReTile.h"
#include "GeometryVolume/channels/Halo.h"
#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/sampling/VoxelSamplerLinear.h"
#include "GeometryVolume/topology/Command.h"

#include <openvdb/points/PointConversion.h>
#include <openvdb/points/PointMove.h>
#include <openvdb/tools/LevelSetSphere.h>

#include <benchmark/benchmark.h>

#include <algorithm>
#include <chrono>
#include <cmath>
#include <map>
#include <random>

using namespace VLN::TileTree3D;
using Shape = PowerOfTwoTraits;
using Velorn::Math::float3;
using Velorn::Math::int3;

namespace {

template <class Body> double seconds(Body const& body) {
  auto const start = std::chrono::steady_clock::now();
  body();
  return std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
}
/// Runs the timed body on the number of threads of the benchmark's first argument.
template <class Body> void timed(benchmark::State& state, Body const& body) {
  VLN::withThreads(static_cast<int>(state.range(0)), [&] { state.SetIterationTime(seconds(body)); });
}

// --- Trees: the shell of a sphere, as leaves of 8 x 8 x 8 voxels there and as tiles of the same voxels here

openvdb::FloatGrid::Ptr vdbFloatShell(double offset) {
  auto sphere = openvdb::tools::createLevelSetSphere<openvdb::FloatGrid>(
      200.0f, openvdb::Vec3f(static_cast<float>(offset), 0, 0), 1.0f, 3.0f);
  // Whole leaves on both sides.
  for (auto leaf = sphere->tree().beginLeaf(); leaf; ++leaf) leaf->setValuesOn();
  return sphere;
}
openvdb::MaskGrid::Ptr vdbShell(double offset) {
  auto mask = openvdb::MaskGrid::create();
  mask->tree().topologyUnion(vdbFloatShell(offset)->tree());
  return mask;
}
void addLeaves(Container<Shape>& tree, openvdb::MaskGrid const& shell) {
  Container<Shape>::TileLists lists;
  for (auto leaf = shell.tree().cbeginLeaf(); leaf; ++leaf) {
    auto const& o = leaf->origin();
    for (int d = 20; d <= 27; ++d) lists[static_cast<std::size_t>(d)].append({o.x(), o.y(), o.z()});
    for (int n = 0; n < 8; ++n) lists[28].append({o.x() + 4 * (n & 1), o.y() + 2 * (n & 2), o.z() + (n & 4)});
  }
  tree.tileAccessor().addTiles(lists);
}
/// A copy that shares nothing.
Container<Shape> privateCopy(Container<Shape> const& tree) {
  Container<Shape> copy = tree;
  copy.tileAccessor().addTiles(Container<Shape>::TileLists{});
  return copy;
}

template <class Shell> void unite(benchmark::State& state, Shell const& shell) {
  auto const a = shell(0), b = shell(24);
  for (auto _ : state) {
    auto copy = a->deepCopy();
    timed(state, [&] { copy->tree().topologyUnion(b->tree()); });
  }
  state.counters["voxels"] = static_cast<double>(b->activeVoxelCount());
  state.counters["leaves"] = b->tree().leafCount();
}
/// Of trees that hold floats: new leaves come with their values.
void BM_TopologyUnion(benchmark::State& state) { unite(state, vdbFloatShell); }
BENCHMARK(BM_TopologyUnion)->Arg(1)->Arg(2)->UseManualTime()->Unit(benchmark::kMillisecond);
/// Of trees that hold bits alone.
void BM_TopologyUnionMask(benchmark::State& state) { unite(state, vdbShell); }
BENCHMARK(BM_TopologyUnionMask)->Arg(1)->Arg(2)->UseManualTime()->Unit(benchmark::kMillisecond);

void BM_Refine(benchmark::State& state) {
  Container<Shape> a, b;
  addLeaves(a, *vdbShell(0));
  addLeaves(b, *vdbShell(24));
  for (auto _ : state) {
    auto copy = privateCopy(a);
    timed(state, [&] { copy.refine({&b}, nullptr, true); });
  }
  state.counters["voxels"] = static_cast<double>(b.tileCount(28)) * 64;
  state.counters["tiles"] = static_cast<double>(b.tileCount(-1));
}
BENCHMARK(BM_Refine)->Arg(1)->Arg(2)->UseManualTime()->Unit(benchmark::kMillisecond);

/// The same, and a float channel that takes the new tiles in.
void BM_RefineWithValues(benchmark::State& state) {
  Container<Shape> a, b;
  addLeaves(a, *vdbShell(0));
  addLeaves(b, *vdbShell(24));
  VoxelTopology<Shape> topology("voxels", kVoxelOffsetCenter);
  topology.update(a);
  Channel<Shape, float, 4, 0> const empty("field", nullptr, kInitializeDefaultValue, false, true, 0, 28);
  for (auto _ : state) {
    auto copy = privateCopy(a);
    auto counts = topology;
    auto field = empty;
    field.update(counts);
    timed(state, [&] {
      copy.refine({&b}, nullptr, true);
      counts.update(copy);
      field.updateTilesAdded(counts);
    });
  }
}
BENCHMARK(BM_RefineWithValues)->Arg(1)->Arg(2)->UseManualTime()->Unit(benchmark::kMillisecond);

void BM_RemoveThird(benchmark::State& state) {
  Container<Shape> tree;
  addLeaves(tree, *vdbShell(0));
  std::mt19937 random(1);
  std::vector<std::int64_t> third;
  for (std::int64_t n = 0; n < tree.tileCount(28); ++n) {
    if (random() % 3 == 0) third.push_back(n);
  }
  for (auto _ : state) {
    auto copy = privateCopy(tree);
    timed(state, [&] { copy.tileAccessor().removeTiles(third, 28, true); });
  }
  state.counters["removed"] = static_cast<double>(third.size());
}
BENCHMARK(BM_RemoveThird)->Arg(1)->Arg(2)->UseManualTime()->Unit(benchmark::kMillisecond);

Container<Shape> shuffledTree() {
  Container<Shape> tree;
  addLeaves(tree, *vdbShell(0));
  std::vector<std::vector<std::int64_t>> perms(29);
  std::mt19937 random(2);
  for (int d = 0; d <= 28; ++d) {
    auto& perm = perms[static_cast<std::size_t>(d)];
    for (std::int64_t n = 0; n < tree.tileCount(d); ++n) perm.push_back(n);
    std::shuffle(perm.begin(), perm.end(), random);
  }
  tree.permute(perms.data());
  return tree;
}

void BM_MortonSort(benchmark::State& state) {
  auto const tree = shuffledTree();
  for (auto _ : state) {
    auto copy = privateCopy(tree);
    timed(state, [&] { copy.sortIntoMortonOrder(); });
  }
  state.counters["tiles"] = static_cast<double>(tree.tileCount(-1));
}
BENCHMARK(BM_MortonSort)->Arg(1)->Arg(2)->UseManualTime()->Unit(benchmark::kMillisecond);

/// Each tile's first sample and those of its six neighbours, before and after the sort.
void BM_ReadNeighbors(benchmark::State& state) {
  auto tree = shuffledTree();
  if (state.range(1)) tree.sortIntoMortonOrder();
  Channel<Shape, float, 4, 0> field("field", nullptr, kInitializeDefaultValue, false, true, 0, 28);
  field.update(tree);
  auto const& values = std::as_const(field);
  std::int64_t const tiles = tree.tileCount(28);
  for (auto _ : state) {
    timed(state, [&] {
      VLN::parallelFor(0, tiles,
                       [&](std::int64_t begin, std::int64_t end) {
                         auto const accessor = std::as_const(tree).tileAccessor();
                         float sum = 0;
                         for (std::int64_t n = begin; n < end; ++n) {
                           int3 const p = std::as_const(tree).tile(n, 28).tijk();
                           for (int a = 0; a < 3; ++a) {
                             for (int const step : {-4, 4}) {
                               int3 q = p;
                               q[a] += step;
                               TreeIndex const at = accessor.treeIndex(q.x, q.y, q.z, 28, true);
                               if (at.valid()) sum += values.tileData(at)[0];
                             }
                           }
                         }
                         benchmark::DoNotOptimize(sum);
                       },
                       {.grain = 1024});
    });
  }
  state.SetItemsProcessed(state.iterations() * tiles * 6);
  state.SetLabel(state.range(1) ? "Morton order" : "shuffled");
}
BENCHMARK(BM_ReadNeighbors)->ArgsProduct({{1, 2}, {0, 1}})->UseManualTime()->Unit(benchmark::kMillisecond);

/// Trilinear samples in the shell, before and after the sort: at random, and along lines through space.
void BM_Sample(benchmark::State& state) {
  auto tree = shuffledTree();
  if (state.range(0)) tree.sortIntoMortonOrder();
  VoxelTopology<Shape> topology("voxels", kVoxelOffsetCenter);
  topology.update(tree);
  Channel<Shape, float, 4, 0> core("core", nullptr, kInitializeDefaultValue, false, true, 0, 28);
  core.update(topology);
  for (float& v : core) v = 1.0f;
  Channel<Shape, float, 5, 0> wide("wide", nullptr, kInitializeDefaultValue, true, true, 0, 28);
  wide.update(topology);
  computeHalo<Shape, float, 0, 0, 1, 0>(core, tree, wide, -1, -1);
  std::vector<float3> places;
  std::mt19937 random(4);
  std::uniform_real_distribution<float> inside(0.5f, 3.4f);
  for (std::int64_t n = 0; n < tree.tileCount(28); ++n) {
    int3 const p = std::as_const(tree).tile(n, 28).tijk();
    for (int i = 0; i < 4; ++i)
      places.push_back({static_cast<float>(p.x) + inside(random), static_cast<float>(p.y) + inside(random),
                        static_cast<float>(p.z) + inside(random)});
  }
  std::shuffle(places.begin(), places.end(), random);
  if (state.range(1)) {
    // Line after line along i through rows of tiles.
    auto const row = [](float3 const& p) { return std::pair(std::floor(p.z / 4), std::floor(p.y / 4)); };
    std::sort(places.begin(), places.end(), [&](float3 const& a, float3 const& b) {
      return row(a) != row(b) ? row(a) < row(b) : a.x < b.x;
    });
  }
  FloatVoxelSamplerLinear<Shape> const sampler(tree, topology, wide);
  for (auto _ : state) {
    state.SetIterationTime(seconds([&] {
      float sum = 0;
      for (float3 const& p : places) sum += sampler.sample(p, kSamplerTileSpace);
      benchmark::DoNotOptimize(sum);
    }));
  }
  state.SetItemsProcessed(state.iterations() * static_cast<std::int64_t>(places.size()));
  state.SetLabel(std::string(state.range(0) ? "Morton order" : "shuffled") +
                 (state.range(1) ? ", along lines" : ", at random"));
}
BENCHMARK(BM_Sample)->ArgsProduct({{0, 1}, {0, 1}})->UseManualTime()->Unit(benchmark::kMillisecond);

// --- Points: a ball of a million, with so many to a voxel

std::vector<float3> const& ball(int perVoxel) {
  static std::map<int, std::vector<float3>> balls;
  auto& points = balls[perVoxel];
  if (!points.empty()) return points;
  constexpr std::size_t kPoints = 1000000;
  float const radius =
      std::cbrt(static_cast<float>(kPoints) / static_cast<float>(perVoxel) * 0.75f / 3.14159265f);
  std::mt19937 random(3);
  std::uniform_real_distribution<float> along(-radius, radius);
  while (points.size() < kPoints) {
    float3 const p{along(random), along(random), along(random)};
    if (p.x * p.x + p.y * p.y + p.z * p.z < radius * radius) points.push_back(p);
  }
  return points;
}

// The move of each step: a third of a voxel, or four voxels, to and fro.
float stepOf(benchmark::State const& state, std::int64_t n) {
  float const length = state.range(1) ? 4.0f : 1.0f / 3.0f;
  return n % 2 == 0 ? length : -length;
}
void report(benchmark::State& state) {
  state.SetItemsProcessed(state.iterations() * 1000000);
  state.SetLabel(std::string(state.range(1) ? "4 voxels, " : "1/3 voxel, ") + std::to_string(state.range(2)) +
                 " points a voxel");
}
#define POINT_ARGS                                                                                           \
  ArgsProduct({{1, 2}, {0, 1}, {1, 8}})->UseManualTime()->Unit(benchmark::kMillisecond)->MinTime(1.0)

struct Along {
  float x;
  template <class Leaf> void reset(Leaf const&, std::size_t) {}
  template <class Index> void apply(openvdb::Vec3d& p, Index const&) const { p.x() += double(x); }
};

void BM_MovePointsVdb(benchmark::State& state) {
  auto const& points = ball(static_cast<int>(state.range(2)));
  std::vector<openvdb::Vec3f> list;
  for (float3 const& p : points) list.emplace_back(p.x, p.y, p.z);
  auto const transform = openvdb::math::Transform::createLinearTransform(1.0);
  auto grid =
      openvdb::points::createPointDataGrid<openvdb::points::NullCodec, openvdb::points::PointDataGrid>(
          list, *transform);
  std::int64_t n = 0;
  for (auto _ : state) {
    Along along{stepOf(state, n++)};
    timed(state, [&] { openvdb::points::movePoints(*grid, along); });
  }
  report(state);
}
BENCHMARK(BM_MovePointsVdb)->POINT_ARGS;

void BM_ReTile(benchmark::State& state) {
  auto const& points = ball(static_cast<int>(state.range(2)));
  Container<Shape> tree("tree", 1.0f);
  Container<Shape>::TileLists lists;
  for (float3 const& p : points) {
    int3 const at{static_cast<int>(std::floor(p.x)), static_cast<int>(std::floor(p.y)),
                  static_cast<int>(std::floor(p.z))};
    for (int d = 20; d <= 28; ++d) lists[static_cast<std::size_t>(d)].append(at);
  }
  tree.tileAccessor().addTiles(lists);
  PointTopology<Shape> topology("points");
  topology.update(tree);
  Channel<Shape, float3, 4, 0> positions("positions", nullptr, kInitializeDefaultValue, false, true, 0, 28);
  positions.updateTilesAdded(topology);
  auto const find = tree.tileAccessor();
  for (float3 const& p : points)
    positions.tileDataAccessor()
        .tileData(find.treeIndex(static_cast<int>(std::floor(p.x)), static_cast<int>(std::floor(p.y)),
                                 static_cast<int>(std::floor(p.z)), 28, true))
        .push(p);
  topology.update(positions);
  VLN::Object object;
  std::int64_t n = 0;
  for (auto _ : state) {
    float const step = stepOf(state, n++);
    timed(state, [&] {
      VLN::parallelFor(0, tree.tileCount(28),
                       [&](std::int64_t begin, std::int64_t end) {
                         for (std::int64_t t = begin; t < end; ++t) {
                           for (float3& p : positions.tileData(t, 28)) p.x += step;
                         }
                       },
                       {.grain = 256});
      channelElementReTile(tree, topology, positions, object, true);
    });
  }
  if (positions.elementCount(-1) != 1000000) state.SkipWithError("points were lost");
  state.counters["tiles"] = static_cast<double>(tree.tileCount(28));
  report(state);
}
BENCHMARK(BM_ReTile)->POINT_ARGS;

} // namespace

int main(int argc, char** argv) {
  openvdb::initialize();
  benchmark::Initialize(&argc, argv);
  benchmark::RunSpecifiedBenchmarks();
}
