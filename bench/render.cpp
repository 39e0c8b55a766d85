// Rays from a camera that frames the grid, 512 x 512 of them, one thread, as values over items a second:
//
//   level set   the first surface of the bunny at 128 voxels, hit or missed, without shading: this library's
//               rays one by one and by blocks of pixels, as pictures are made, with the whole picture beside
//               them; OpenVDB's LevelSetRayIntersector and NanoVDB's zero crossing on the same rays
//   fog         shaded pixels of the preview of the smoke, those beside it included; NanoVDB's marcher
//   through
//               the same grid, with a blend at every voxel's width, but neither light nor shadows
#include "BenchGrids.h"
#include "GeometryVolume/core/Parallel.h"
#include "Interop/Flatten.h"
#include "Interop/VdbDetails.h"
#include "Render/PixelBlocks.h"
#include "Render/Renderer.h"
#include "Render/Surface.h"

#include <benchmark/benchmark.h>
#include <openvdb/tools/LevelSetSphere.h>
#include <openvdb/tools/RayIntersector.h>

#include <cmath>
#include <memory>

#include <nanovdb/util/HDDA.h>
#include <nanovdb/util/OpenToNanoVDB.h>
#include <nanovdb/util/Ray.h>
#include <nanovdb/util/SampleFromVoxels.h>

namespace {

using namespace VLN;
using namespace VLN::Render;

constexpr int kAcross = 512;

openvdb::FloatGrid::Ptr gridOf(char const* name) {
  openvdb::initialize();
  std::string const folder = VLN_BENCH_DATA_DIR;
  std::filesystem::path const file = std::filesystem::path(folder) / "vdb" / name;
  std::error_code unknown;
  if (!folder.empty() && std::filesystem::exists(file, unknown)) return Bench::readFloatGrid(file.string());
  return openvdb::tools::createLevelSetSphere<openvdb::FloatGrid>(60, {0, 0, 0}, 1, 3);
}

struct Data {
  openvdb::FloatGrid::Ptr grid;
  Interop::VdbImport content;
  Interop::FlatVolume flat;
  std::unique_ptr<Field> field;
  Affine toWorld;
  Camera camera;

  explicit Data(char const* name)
      : grid(gridOf(name))
      , content(Bench::importGrid(grid)) {
    auto const& volume = content.volumes.at(0);
    Interop::FlattenOptions options;
    options.channels = volume.channels.at(0).name, options.haloFraction = 1;
    flat = Interop::flattenVolume(*volume.object, options);
    field = std::make_unique<Field>(nanovtt::BufferReader(flat.buffer.data()).grid(0));
    auto const rows = Interop::matrixOf(volume.indexToWorld);
    for (int a = 0; a < 3; ++a) {
      auto const& row = rows[static_cast<std::size_t>(a)];
      toWorld.rows[a] = {row[0], row[1], row[2]}, toWorld.shift[a] = row[3];
    }
    std::vector<Vec3d> outline;
    for (Vec3 const &p : field->outline([&](float low, float high) { return low != high; }))
      outline.push_back(toWorld.point(p.as<double>() + field->origin()));
    camera = Camera({}, outline, 0, 1);
  }
  template <class Body> void forRays(Body const& body) const {
    for (int y = 0; y < kAcross; ++y)
      for (int x = 0; x < kAcross; ++x) body(camera.ray((x + 0.5) / kAcross, (y + 0.5) / kAcross));
  }
};

Data& bunny() {
  static Data data("bunny_ls_128.vdb");
  return data;
}

Data& smoke() {
  static Data data("smoke.vdb");
  return data;
}

void finish(benchmark::State& state, std::int64_t hits) {
  state.SetItemsProcessed(state.iterations() * kAcross * kAcross);
  state.counters["hits"] = static_cast<double>(hits);
}

void onOneAndTwoThreads(benchmark::internal::Benchmark* bench) {
  bench->ArgName("threads")->Arg(1)->Arg(2);
  bench->MeasureProcessCPUTime()->UseRealTime()->Unit(benchmark::kMillisecond);
}

void levelSetOurs(benchmark::State& state) {
  Data& data = bunny();
  data.field->weigh([](float low, float high) { return crosses(low, high, 0) ? 1.0f : 0.0f; });
  FieldView const& view = data.field->view();
  Affine local = data.toWorld.inverse();
  local.shift = local.shift - data.field->origin();
  Vec3d const eye = local.point(data.camera.position);
  // As render() does it: floats begin near the box.
  double const near = 0.5 * length(data.camera.position - data.camera.focalPoint);
  std::int64_t hits = 0;
  for (auto _ : state) {
    hits = 0;
    data.forRays([&](Vec3d const& world) {
      Vec3d const d = local.vector(world);
      Ray const ray((eye + d * near).as<float>(), d.as<float>());
      float t;
      hits += hitSurface(view, ray, 0, 3e38f, 0, t);
    });
  }
  finish(state, hits);
}
BENCHMARK(levelSetOurs)->Name("level set/this library")->Unit(benchmark::kMillisecond);

// As pictures are made: rays begin where the tiles that matter do in their block of pixels.
void levelSetBlocks(benchmark::State& state) {
  Data& data = bunny();
  data.field->weigh([](float low, float high) { return crosses(low, high, 0) ? 1.0f : 0.0f; });
  FieldView const& view = data.field->view();
  Affine toWorld = data.toWorld;
  toWorld.shift = toWorld.point(data.field->origin());
  Affine const local = toWorld.inverse();
  Vec3d const eye = local.point(data.camera.position);
  std::int64_t hits = 0;
  for (auto _ : state) {
    hits = 0;
    PixelBlocks const blocks(view, toWorld, data.camera, kAcross, kAcross);
    for (int y = 0; y < kAcross; ++y)
      for (int x = 0; x < kAcross; ++x) {
        auto const& span = blocks.at(x, y);
        if (span.empty()) continue;
        Vec3d const d = local.vector(data.camera.ray((x + 0.5) / kAcross, (y + 0.5) / kAcross));
        Ray const ray((eye + d * double(span.near)).as<float>(), d.as<float>());
        float t;
        hits += hitSurface(view, ray, 0, span.far - span.near, 0, t);
      }
  }
  finish(state, hits);
}
BENCHMARK(levelSetBlocks)->Name("level set/this library, by blocks of pixels")->Unit(benchmark::kMillisecond);

// The whole: also the normal and the light of what they meet, and what is done once for a picture; without
// rays to the light.
void levelSetPicture(benchmark::State& state) {
  Data& data = bunny();
  RenderOptions options;
  options.width = options.height = kAcross;
  options.mode = Mode::kSurface;
  options.samples = 1, options.occlusionRays = 0, options.threads = static_cast<int>(state.range(0));
  std::int64_t hits = 0;
  for (auto _ : state) {
    auto const picture = render(*data.field, data.toWorld, data.camera, options);
    hits = 0;
    for (float const opacity : picture.opacity) hits += opacity > 0;
  }
  finish(state, hits);
}
BENCHMARK(levelSetPicture)->Name("level set/this library, picture")->Apply(onOneAndTwoThreads);

void levelSetOpenVdb(benchmark::State& state) {
  Data& data = bunny();
  openvdb::tools::LevelSetRayIntersector<openvdb::FloatGrid> intersector(*data.grid);
  Vec3d const p = data.camera.position;
  std::int64_t hits = 0;
  for (auto _ : state) {
    hits = 0;
    data.forRays([&](Vec3d const& d) {
      openvdb::math::Ray<double> const ray({p.x, p.y, p.z}, {d.x, d.y, d.z});
      openvdb::Vec3d at;
      hits += intersector.intersectsWS(ray, at);
    });
  }
  finish(state, hits);
}
BENCHMARK(levelSetOpenVdb)->Name("level set/OpenVDB LevelSetRayIntersector")->Unit(benchmark::kMillisecond);

using NanoRay = nanovdb::Ray<float>;

/// Sends the rays on the threads of the first argument: `body(accessor, ray)` for each, in index space.
/// @return The sum of what it gives.
template <class Body>
double forNanoRays(benchmark::State& state, Data const& data, nanovdb::FloatGrid const& grid,
                   Body const& body) {
  Vec3d const p = data.camera.position;
  double sum = 0;
  withThreads(static_cast<int>(state.range(0)), [&] {
    sum = parallelReduce(
        0, kAcross, 8, 0.0,
        [&](std::int64_t begin, std::int64_t end) {
          double part = 0;
          auto accessor = grid.getAccessor();
          for (auto y = begin; y < end; ++y)
            for (int x = 0; x < kAcross; ++x) {
              Vec3d const d = data.camera.ray((x + 0.5) / kAcross, (double(y) + 0.5) / kAcross);
              NanoRay const world({float(p.x), float(p.y), float(p.z)}, {float(d.x), float(d.y), float(d.z)});
              part += body(accessor, world.worldToIndexF(grid));
            }
          return part;
        },
        [](double a, double b) { return a + b; });
  });
  return sum;
}

void levelSetNano(benchmark::State& state) {
  Data& data = bunny();
  auto const handle = nanovdb::openToNanoVDB(*data.grid);
  double hits = 0;
  for (auto _ : state)
    hits = forNanoRays(state, data, *handle.grid<float>(), [](auto& accessor, NanoRay ray) {
      nanovdb::Coord cell;
      float value, t;
      return nanovdb::ZeroCrossing(ray, accessor, cell, value, t) ? 1.0 : 0.0;
    });
  finish(state, static_cast<std::int64_t>(hits));
}
BENCHMARK(levelSetNano)->Name("level set/NanoVDB ZeroCrossing (voxel, not root)")->Apply(onOneAndTwoThreads);

// 0 samples: as previews are made; 1: with a ray for each pixel.
void fogOurs(benchmark::State& state) {
  Data& data = smoke();
  RenderOptions options;
  options.width = options.height = kAcross;
  options.threads = static_cast<int>(state.range(1)), options.samples = static_cast<int>(state.range(0));
  options.transfer.high = data.field->high();
  Picture picture;
  for (auto _ : state) picture = render(*data.field, data.toWorld, data.camera, options);
  finish(state, 0);
  state.counters["rays alone, s"] = picture.seconds;
  state.counters["rays"] = static_cast<double>(picture.rays);
}
BENCHMARK(fogOurs)
    ->Name("fog/this library, preview with its preparation")
    ->ArgNames({"samples", "threads"})
    ->Args({1, 1})
    ->Args({0, 1})
    ->Args({0, 2})
    ->MeasureProcessCPUTime()
    ->UseRealTime()
    ->Unit(benchmark::kMillisecond);

// How much of each ray's light goes through.
void fogNano(benchmark::State& state) {
  Data& data = smoke();
  auto const handle = nanovdb::openToNanoVDB(*data.grid);
  using Accessor = nanovdb::FloatGrid::AccessorType;
  using Marcher = nanovdb::TreeMarcher<nanovdb::LeafNode<float>, NanoRay, Accessor>;
  double opacity = 0;
  for (auto _ : state)
    opacity = forNanoRays(state, data, *handle.grid<float>(), [](Accessor& accessor, NanoRay const& ray) {
      Marcher marcher(accessor);
      if (!marcher.init(ray)) return 0.0;
      auto const sampler = nanovdb::createSampler<1>(accessor);
      float through = 1, t0 = 0, t1 = 0;
      nanovdb::LeafNode<float> const* leaf = nullptr;
      while (through >= 2e-3f && marcher.step(&leaf, t0, t1))
        for (float t = std::ceil(t0); t < t1; t += 1) through *= std::exp(-0.1f * sampler(ray(t)));
      return 1.0 - double(through);
    });
  finish(state, 0);
  state.counters["opacity"] = opacity / (kAcross * kAcross);
}
BENCHMARK(fogNano)->Name("fog/NanoVDB TreeMarcher, opacity alone")->Apply(onOneAndTwoThreads);

} // namespace
