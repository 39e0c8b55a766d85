// Filling halos, in bytes of target data, beside memcpy of the same amount; and rising values.
//
// The volume is the narrow band of a sphere: tiles of 4 samples within a few voxels of its surface, below all
// their ancestors.
#include "GeometryVolume/channels/Halo.h"
#include "GeometryVolume/channels/NonLeafValues.h"
#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/topology/VoxelTopology.h"

#include <benchmark/benchmark.h>

#include <cmath>
#include <cstring>
#include <memory>

namespace {

using namespace VLN::TileTree3D;
using Shape = PowerOfTwoTraits;
using Tree = Container<Shape>;

struct Volume {
  Volume()
      : tree("", 1.0f)
      , topology("", kVoxelOffsetCorner) {
    constexpr int kRadius = 200, kReach = 208, kFirst = Shape::kMaxDepth - 6;
    Tree::TileLists corners;
    for (int d = kFirst; d <= Shape::kMaxDepth; ++d) {
      int const w = Shape::width(d), low = Shape::align(-kReach, d);
      for (int k = low; k < kReach; k += w)
        for (int j = low; j < kReach; j += w)
          for (int i = low; i < kReach; i += w)
            if (std::abs(std::hypot(i + w / 2.0, j + w / 2.0, k + w / 2.0) - kRadius) < 3 + 0.87 * w)
              corners[static_cast<std::size_t>(d)].append({i, j, k});
    }
    tree.tileAccessor().addTiles(corners);
    topology.update(tree);
  }
  template <class ChannelT> std::unique_ptr<ChannelT> channel() const {
    float const zero = 0;
    auto made =
        std::make_unique<ChannelT>("", &zero, kInitializeDefaultValue, true, true, 0, Shape::kMaxDepth);
    made->update(topology);
    return made;
  }

  Tree tree;
  VoxelTopology<Shape> topology;
};

Volume const& volume() {
  static auto const* const made = new Volume;
  return *made;
}

template <class ChannelT> std::int64_t bytesOf(ChannelT const& channel) {
  return channel.tileCount(-1) * std::int64_t(sizeof(float)) * ChannelT::kSize;
}

template <int a, int b, int c, int d> void plainHalo(benchmark::State& state) {
  auto const source = volume().channel<Channel<Shape, float, 4 + a, b>>();
  auto const target = volume().channel<Channel<Shape, float, 4 + c, d>>();
  VLN::withThreads(static_cast<int>(state.range(0)), [&] {
    for (auto _ : state) computeHalo<Shape, float, a, b, c, d>(*source, volume().tree, *target, -1, -1);
  });
  state.SetBytesProcessed(static_cast<std::int64_t>(state.iterations()) * bytesOf(*target));
  state.counters["tiles"] = static_cast<double>(volume().tree.tileCount(-1));
}

template <int h1, int h2> void modeHalo(benchmark::State& state) {
  auto const source = volume().channel<Channel<Shape, float, 4, h1>>();
  auto const target = volume().channel<Channel<Shape, float, 4, h2>>();
  VLN::withThreads(static_cast<int>(state.range(0)), [&] {
    for (auto _ : state)
      computeHalo<Shape, float, 4, h1, h2>(static_cast<HaloMode>(state.range(1)), kHaloAll, -1, -1, *source,
                                           volume().tree, *target, 1.0f, kVoxelOffsetCorner, 0.0f);
  });
  state.SetBytesProcessed(static_cast<std::int64_t>(state.iterations()) * bytesOf(*target));
}

// As many bytes as a wide channel of the volume holds.
void copyMemory(benchmark::State& state) {
  auto const bytes = static_cast<std::size_t>(volume().tree.tileCount(-1)) * sizeof(float) *
                     Channel<Shape, float, 5, 0>::kSize;
  std::unique_ptr<char[]> const from(new char[bytes]()), to(new char[bytes]());
  VLN::withThreads(static_cast<int>(state.range(0)), [&] {
    for (auto _ : state)
      VLN::parallelFor(0, static_cast<std::int64_t>(bytes),
                       [&](std::int64_t begin, std::int64_t end) {
                         std::memcpy(to.get() + begin, from.get() + begin,
                                     static_cast<std::size_t>(end - begin));
                       },
                       {.grain = 1 << 20});
  });
  state.SetBytesProcessed(static_cast<std::int64_t>(state.iterations()) * static_cast<std::int64_t>(bytes));
}

std::int64_t coarseSamples() {
  return 64 * (volume().tree.tileCount(-1) - volume().tree.tileCount(Shape::kMaxDepth));
}

void nonLeafValues(benchmark::State& state) {
  auto const channel = volume().channel<Channel<Shape, float, 4, 0>>();
  VLN::withThreads(static_cast<int>(state.range(0)), [&] {
    for (auto _ : state)
      setNonLeafValueToChildValue(*channel, volume().tree, kVoxelOffsetCorner, 0, Shape::kMaxDepth);
  });
  state.SetItemsProcessed(static_cast<std::int64_t>(state.iterations()) * coarseSamples());
}

void checkNonLeafValues(benchmark::State& state) {
  auto const channel = volume().channel<Channel<Shape, float, 4, 0>>();
  VLN::withThreads(static_cast<int>(state.range(0)), [&] {
    for (auto _ : state)
      benchmark::DoNotOptimize(checkIfNonLeafValueIsSetToChildValue(
          *channel, volume().tree, kVoxelOffsetCorner, 0.0f, 0, Shape::kMaxDepth));
  });
  state.SetItemsProcessed(static_cast<std::int64_t>(state.iterations()) * coarseSamples());
}

#define VLN_THREADS(function, name)                                                                          \
  BENCHMARK(function)->Name(name)->ArgName("threads")->Arg(1)->Arg(2)->UseRealTime()->Unit(                  \
      benchmark::kMillisecond)
#define VLN_MODES(function, name)                                                                            \
  BENCHMARK(function)                                                                                        \
      ->Name(name)                                                                                           \
      ->ArgNames({"threads", "mode"})                                                                        \
      ->ArgsProduct({{1, 2}, {0, 1, 2, 3, 4, 5}})                                                            \
      ->UseRealTime()                                                                                        \
      ->Unit(benchmark::kMillisecond)

VLN_THREADS(copyMemory, "memcpy");
VLN_THREADS((plainHalo<0, 0, 0, 0>), "computeHalo float (4,0) to (4,0)");
VLN_THREADS((plainHalo<0, 0, 1, 0>), "computeHalo float (4,0) to (5,0)");
VLN_THREADS((plainHalo<0, 0, 0, 1>), "computeHalo float (4,0) to (4,1)");
VLN_THREADS((plainHalo<0, 1, 1, 0>), "computeHalo float (4,1) to (5,0)");
VLN_THREADS((plainHalo<1, 0, 1, 0>), "computeHalo float (5,0) to (5,0)");
VLN_MODES((modeHalo<0, 1>), "computeHalo float (4,0) to (4,1) with mode");
VLN_MODES((modeHalo<0, 2>), "computeHalo float (4,0) to (4,2) with mode");
VLN_MODES((modeHalo<1, 1>), "computeHalo float (4,1) to (4,1) with mode");
VLN_THREADS(nonLeafValues, "setNonLeafValueToChildValue float (4,0)");
VLN_THREADS(checkNonLeafValues, "checkIfNonLeafValueIsSetToChildValue float (4,0)");

} // namespace
