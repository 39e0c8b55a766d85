// Trilinear samples: this library, OpenVDB's BoxSampler on a ValueAccessor and NanoVDB's trilinear sampler on
// the same grid at the same positions:
//
//   at random     in cells of the narrow band whose eight voxels are all active
//   rays          across the grid's box in steps of half a voxel, in the band and beside it
//   rays in band  of such rays the positions in the band alone: short runs, far from each other
//
// The grid is the bunny's level set, or that of a sphere where there are no real volumes.
#include "BenchGrids.h"
#include "GeometryVolume/channels/Halo.h"
#include "GeometryVolume/sampling/VoxelSamplerLinear.h"

#include <benchmark/benchmark.h>
#include <openvdb/tools/Interpolation.h>

#include <algorithm>
#include <array>
#include <random>

#include <nanovdb/util/OpenToNanoVDB.h>
#include <nanovdb/util/SampleFromVoxels.h>

namespace {

using namespace VLN;
using namespace VLN::TileTree3D;
using Shape = PowerOfTwoTraits;
using Core = Channel<Shape, float, 4, 0>;
using Wide = Channel<Shape, float, 5, 0>;
using Tree = Container<Shape>;
using Sampler = FloatVoxelSamplerLinear<Shape>;

constexpr std::size_t kPositions = 1 << 19;

struct Data {
  openvdb::FloatGrid::Ptr grid;
  nanovdb::GridHandle<nanovdb::HostBuffer> nano;
  Interop::VdbImport content;
  Ostil::Ptr<Tree> tree;
  Ostil::Ptr<VoxelTopology<Shape>> topology;
  Ostil::Ptr<Core> core;
  std::unique_ptr<Wide> wide;
  std::array<std::vector<float3>, 3> positions; ///< by pattern

  Data() {
    grid = Bench::benchGrids().front().grid;
    content = Bench::importGrid(grid);
    nano = nanovdb::openToNanoVDB(*grid);
    auto const& volume = content.volumes.at(0);
    tree = volume.object->component<Tree>(Interop::kVdbContainerName);
    topology = volume.object->component<VoxelTopology<Shape>>(Interop::kVdbTopologyName);
    core = volume.object->component<Core>(volume.channels.at(0).name);
    float const background = core->defaultValue();
    wide = std::make_unique<Wide>("", &background, kInitializeDefaultValue, true, true, core->minDepth(),
                                  core->depth());
    wide->update(*topology);
    computeHalo<Shape, float, 0, 0, 1, 0>(*core, *tree, *wide, -1, -1);
    makePositions();
  }

  // Cells whose eight voxels are all active.
  void makePositions() {
    auto values = grid->getConstAccessor();
    auto const active = [&](openvdb::Coord const& c) {
      for (int n = 0; n < 8; ++n)
        if (!values.isValueOn(c.offsetBy(n & 1, n >> 1 & 1, n >> 2))) return false;
      return true;
    };
    std::mt19937 generator(7);
    std::uniform_real_distribution<float> inside(0.0f, 1.0f);
    std::vector<openvdb::Coord> voxels;
    for (auto it = grid->cbeginValueOn(); it; ++it)
      if (it.isVoxelValue()) voxels.push_back(it.getCoord());
    auto& [random, rays, band] = positions;
    while (random.size() < kPositions) {
      auto const c = voxels[generator() % voxels.size()];
      if (active(c))
        random.push_back({float(c.x()) + inside(generator), float(c.y()) + inside(generator),
                          float(c.z()) + inside(generator)});
    }
    auto const box = grid->evalActiveVoxelBoundingBox();
    while (band.size() < kPositions) {
      openvdb::Vec3d from, to;
      for (int a = 0; a < 3; ++a) {
        double const low = box.min()[a], extent = box.dim()[a];
        from[a] = low + double(inside(generator)) * extent, to[a] = low + double(inside(generator)) * extent;
      }
      auto const direction = (to - from).unit();
      double const length = (to - from).length();
      for (double t = 0; t < length; t += 0.5) {
        auto const p = from + t * direction;
        float3 const position{float(p.x()), float(p.y()), float(p.z())};
        if (rays.size() < kPositions) rays.push_back(position);
        if (active(openvdb::Coord::floor(p))) band.push_back(position);
      }
    }
  }
};

Data const& data() {
  static auto const* const made = new Data;
  return *made;
}

// Calls f for all positions of the pattern.
template <class F> void forPortions(benchmark::State& state, F const& f) {
  auto const pattern = static_cast<std::size_t>(state.range(0));
  for (auto _ : state) f();
  double const samples =
      static_cast<double>(state.iterations()) * static_cast<double>(data().positions[pattern].size());
  // Seconds for a sample; shown with its unit.
  state.counters["sample"] =
      benchmark::Counter(samples, benchmark::Counter::kIsRate | benchmark::Counter::kInvert);
  static constexpr char const* kNames[] = {"at random", "rays", "rays in band"};
  state.SetLabel(kNames[pattern]);
}
// Calls f for each position of the pattern.
template <class F> void forPositions(benchmark::State& state, F const& f) {
  auto const& positions = data().positions[static_cast<std::size_t>(state.range(0))];
  forPortions(state, [&] {
    float sum = 0;
    for (float3 const& p : positions) sum += f(p);
    benchmark::DoNotOptimize(sum);
  });
}

template <class ChannelT> void ours(benchmark::State& state, Tree const& tree, ChannelT const& channel) {
  Sampler const sampler(tree, *data().topology, channel);
  forPositions(state, [&](float3 const& p) { return sampler.sample(p, kSamplerTileSpace); });
}
template <class ChannelT>
void oursGradient(benchmark::State& state, Tree const& tree, ChannelT const& channel) {
  Sampler const sampler(tree, *data().topology, channel);
  forPositions(state, [&](float3 const& p) {
    float3 g;
    float const value = sampler.sampleGradient(p, kSamplerTileSpace, &g);
    return value + g.x + g.y + g.z;
  });
}

void wideChannel(benchmark::State& s) { ours(s, *data().tree, *data().wide); }
void wideGradient(benchmark::State& s) { oursGradient(s, *data().tree, *data().wide); }
void coreChannel(benchmark::State& s) { ours(s, *data().tree, *data().core); }
void coreGradient(benchmark::State& s) { oursGradient(s, *data().tree, *data().core); }

// All positions in one call.
template <class ChannelT> void oursAtOnce(benchmark::State& state, ChannelT const& channel) {
  Sampler const sampler(*data().tree, *data().topology, channel);
  auto const& positions = data().positions[static_cast<std::size_t>(state.range(0))];
  std::vector<float> values(positions.size());
  forPortions(state, [&] {
    sampler.sample(positions.data(), values.data(), static_cast<std::int64_t>(values.size()),
                   Shape::kMaxDepth, kSamplerTileSpace);
    benchmark::DoNotOptimize(values.data());
  });
}
void wideAtOnce(benchmark::State& s) { oursAtOnce(s, *data().wide); }
void coreAtOnce(benchmark::State& s) { oursAtOnce(s, *data().core); }

void boxSampler(benchmark::State& state) {
  auto const values = data().grid->getConstAccessor();
  forPositions(state, [&](float3 const& p) {
    return openvdb::tools::BoxSampler::sample(values, openvdb::Vec3d(double(p.x), double(p.y), double(p.z)));
  });
}

void nanoSampler(benchmark::State& state) {
  auto const values = data().nano.grid<float>()->getAccessor();
  auto const sampler = nanovdb::createSampler<1>(values);
  forPositions(state, [&](float3 const& p) { return sampler(nanovdb::Vec3f(p.x, p.y, p.z)); });
}
void nanoGradient(benchmark::State& state) {
  auto const values = data().nano.grid<float>()->getAccessor();
  auto const sampler = nanovdb::createSampler<1>(values);
  forPositions(state, [&](float3 const& p) {
    auto const q = nanovdb::Vec3f(p.x, p.y, p.z);
    auto const g = sampler.gradient(q);
    return sampler(q) + g[0] + g[1] + g[2];
  });
}

#define VLN_BENCHMARK(function, name)                                                                        \
  BENCHMARK(function)->Name(name)->ArgName("pattern")->Arg(0)->Arg(1)->Arg(2)->Unit(benchmark::kMillisecond)
VLN_BENCHMARK(boxSampler, "OpenVDB BoxSampler");
VLN_BENCHMARK(nanoSampler, "NanoVDB trilinear");
VLN_BENCHMARK(wideChannel, "wide channel");
VLN_BENCHMARK(wideAtOnce, "wide channel, many at once");
VLN_BENCHMARK(coreChannel, "core channel");
VLN_BENCHMARK(coreAtOnce, "core channel, many at once");
VLN_BENCHMARK(nanoGradient, "NanoVDB trilinear with gradient");
VLN_BENCHMARK(wideGradient, "wide channel with gradient");
VLN_BENCHMARK(coreGradient, "core channel with gradient");

} // namespace
