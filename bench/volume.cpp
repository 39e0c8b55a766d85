// Writing and reading values through a volume's field, beside OpenVDB's accessor on the same positions in the
// same run. "New" begins with an empty volume, "again" writes into tiles that exist.
#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/volume/ForEach.h"
#include "Interop/VdbTypesImpl.h"

#include <benchmark/benchmark.h>

#include <algorithm>
#include <cmath>
#include <cstdlib>
#include <memory>
#include <random>
#include <string>
#include <vector>

using namespace VLN::TileTree3D;
using Velorn::Math::int3;

namespace {

enum Order { kInOrder, kAtRandom, kBand };
enum Start { kNew, kAgain };

/// A cube of voxels: k fastest, which is OpenVDB's own order, i fastest, which is this library's, or
/// shuffled; and the band around a sphere as OpenVDB lists it, by its leaves of 8 x 8 x 8 voxels.
constexpr int kWidth = 160;

struct Case {
  std::vector<int3> positions;
  std::vector<float> values;
};

Case const& cases(Order order) {
  static Case const inOrder = [] {
    Case c;
    for (int k = 0; k < kWidth; ++k)
      for (int j = 0; j < kWidth; ++j)
        for (int i = 0; i < kWidth; ++i) c.positions.push_back({i - 80, j - 80, k - 80});
    for (std::size_t n = 0; n < c.positions.size(); ++n) c.values.push_back(float(n % 1000) + 1);
    return c;
  }();
  static Case const atRandom = [] {
    Case c = inOrder;
    std::shuffle(c.positions.begin(), c.positions.end(), std::mt19937(7));
    return c;
  }();
  static Case const band = [] {
    Case c;
    constexpr int kRadius = 160, kEnd = 168;
    for (int z = -kEnd; z < kEnd; z += 8)
      for (int y = -kEnd; y < kEnd; y += 8)
        for (int x = -kEnd; x < kEnd; x += 8)
          for (int n = 0; n < 512; ++n) {
            int3 const p{x + n / 64, y + n / 8 % 8, z + n % 8};
            if (std::abs(std::hypot(p.x, p.y, p.z) - kRadius) < 3) c.positions.push_back(p);
          }
    for (std::size_t n = 0; n < c.positions.size(); ++n) c.values.push_back(float(n % 1000) + 1);
    return c;
  }();
  return order == kInOrder ? inOrder : order == kAtRandom ? atRandom : band;
}

/// For the side whose leaves hold z fastest: each side is given the order that suits it.
std::vector<int3> const& turned() {
  static std::vector<int3> const list = [] {
    std::vector<int3> turned = cases(kInOrder).positions;
    for (int3& p : turned) std::swap(p.x, p.z);
    return turned;
  }();
  return list;
}

/// What the first two arguments say.
void label(benchmark::State& state) {
  constexpr char const* kOrders[] = {"in order, ", "at random, ", "a band by leaves, "};
  state.SetLabel(std::string(kOrders[state.range(0)]) + (state.range(1) == kNew ? "new" : "again"));
}
void report(benchmark::State& state, std::size_t count) {
  state.SetItemsProcessed(state.iterations() * static_cast<std::int64_t>(count));
}

void BM_VdbSetValue(benchmark::State& state) {
  auto const order = static_cast<Order>(state.range(0));
  auto const start = static_cast<Start>(state.range(1));
  Case const& c = cases(order);
  auto const& positions = order == kInOrder ? turned() : c.positions;
  auto grid = openvdb::FloatGrid::create(0.0f);
  auto const write = [&] {
    auto accessor = grid->getAccessor();
    for (std::size_t n = 0; n < positions.size(); ++n) {
      int3 const& p = positions[n];
      accessor.setValue(openvdb::Coord(p.x, p.y, p.z), c.values[n]);
    }
  };
  if (start == kAgain) write();
  for (auto _ : state) {
    if (start == kNew) {
      state.PauseTiming();
      grid = openvdb::FloatGrid::create(0.0f);
      state.ResumeTiming();
    }
    write();
  }
  label(state);
  report(state, c.positions.size());
}
BENCHMARK(BM_VdbSetValue)
    ->ArgsProduct({{kInOrder, kAtRandom, kBand}, {kNew, kAgain}})
    ->Unit(benchmark::kMillisecond);

void BM_FieldSet(benchmark::State& state) {
  auto const start = static_cast<Start>(state.range(1));
  Case const& c = cases(static_cast<Order>(state.range(0)));
  auto volume = std::make_unique<Volume>();
  auto field = volume->addField<float>("density", 0);
  auto const write = [&] {
    for (std::size_t n = 0; n < c.positions.size(); ++n) field.set(c.positions[n], c.values[n]);
  };
  if (start == kAgain) write();
  for (auto _ : state) {
    if (start == kNew) {
      state.PauseTiming();
      volume = std::make_unique<Volume>();
      field = volume->addField<float>("density", 0);
      state.ResumeTiming();
    }
    write();
  }
  label(state);
  report(state, c.positions.size());
}
BENCHMARK(BM_FieldSet)
    ->ArgsProduct({{kInOrder, kAtRandom, kBand}, {kNew, kAgain}})
    ->Unit(benchmark::kMillisecond);

/// All positions in one call, on the threads of the third argument.
void BM_FieldSetBulk(benchmark::State& state) {
  auto const start = static_cast<Start>(state.range(1));
  Case const& c = cases(static_cast<Order>(state.range(0)));
  VLN::withThreads(static_cast<int>(state.range(2)), [&] {
    auto volume = std::make_unique<Volume>();
    auto field = volume->addField<float>("density", 0);
    if (start == kAgain) field.set(c.positions, c.values);
    for (auto _ : state) {
      if (start == kNew) {
        state.PauseTiming();
        volume = std::make_unique<Volume>();
        field = volume->addField<float>("density", 0);
        state.ResumeTiming();
      }
      field.set(c.positions, c.values);
    }
  });
  label(state);
  report(state, c.positions.size());
}
BENCHMARK(BM_FieldSetBulk)
    ->ArgsProduct({{kInOrder, kAtRandom, kBand}, {kNew, kAgain}, {1, 2}})
    ->Unit(benchmark::kMillisecond)
    ->UseRealTime();

void BM_VdbGetValue(benchmark::State& state) {
  auto const order = static_cast<Order>(state.range(0));
  Case const& c = cases(order);
  auto const& positions = order == kInOrder ? turned() : c.positions;
  auto grid = openvdb::FloatGrid::create(0.0f);
  {
    auto accessor = grid->getAccessor();
    for (std::size_t n = 0; n < positions.size(); ++n)
      accessor.setValue(openvdb::Coord(positions[n].x, positions[n].y, positions[n].z), c.values[n]);
  }
  for (auto _ : state) {
    auto const accessor = grid->getConstAccessor();
    double sum = 0;
    for (int3 const& p : positions) sum += double(accessor.getValue(openvdb::Coord(p.x, p.y, p.z)));
    benchmark::DoNotOptimize(sum);
  }
  report(state, c.positions.size());
}
BENCHMARK(BM_VdbGetValue)->Arg(kInOrder)->Arg(kAtRandom)->Unit(benchmark::kMillisecond);

void BM_FieldGet(benchmark::State& state) {
  Case const& c = cases(static_cast<Order>(state.range(0)));
  Volume volume;
  auto field = volume.addField<float>("density", 0);
  field.set(c.positions, c.values);
  for (auto _ : state) {
    double sum = 0;
    for (int3 const& p : c.positions) sum += double(field.get(p));
    benchmark::DoNotOptimize(sum);
  }
  report(state, c.positions.size());
}
BENCHMARK(BM_FieldGet)->Arg(kInOrder)->Arg(kAtRandom)->Unit(benchmark::kMillisecond);

/// All positions in one call, on the threads of the second argument.
void BM_FieldGetBulk(benchmark::State& state) {
  Case const& c = cases(static_cast<Order>(state.range(0)));
  VLN::withThreads(static_cast<int>(state.range(1)), [&] {
    Volume volume;
    auto field = volume.addField<float>("density", 0);
    field.set(c.positions, c.values);
    std::vector<float> values(c.positions.size());
    for (auto _ : state) {
      field.get(c.positions, values);
      benchmark::DoNotOptimize(values.data());
      benchmark::ClobberMemory();
    }
  });
  report(state, c.positions.size());
}
BENCHMARK(BM_FieldGetBulk)
    ->ArgsProduct({{kInOrder, kAtRandom}, {1, 2}})
    ->Unit(benchmark::kMillisecond)
    ->UseRealTime();

/// A seven-point stencil over all samples, from one field to another, on the threads of the argument.
void BM_FieldStencil(benchmark::State& state) {
  Case const& c = cases(kInOrder);
  VLN::withThreads(static_cast<int>(state.range(0)), [&] {
    Volume volume;
    auto from = volume.addField<float>("from", 0);
    auto to = volume.addField<float>("to", 0);
    from.set(c.positions, c.values);
    for (auto _ : state)
      forEachSample(from, to, [](Neighbors<float> const& n) {
        return n(0, 0, 0) + 0.1f * (n(-1, 0, 0) + n(1, 0, 0) + n(0, -1, 0) + n(0, 1, 0) + n(0, 0, -1) +
                                    n(0, 0, 1) - 6 * n(0, 0, 0));
      });
  });
  report(state, c.positions.size());
}
BENCHMARK(BM_FieldStencil)->Arg(1)->Arg(2)->Unit(benchmark::kMillisecond)->UseRealTime();

} // namespace
