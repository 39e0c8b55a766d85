// Flat buffers beside NanoVDB's own conversion of the same grids in the same run:
//
//   flatten    a volume into one buffer, no halos, no checksum, the box of what is active; GB/s are those of
//              the output. NanoVDB's "openToNanoVDB" with StatsMode::BBox and no checksum does the same work
//   memcpy     the same number of bytes, into memory that is mapped anew like that of a new buffer
//   validate   of the whole buffer before it is trusted
//   read       a million active voxels, leaf by leaf or at random, through NanoVDB's accessor and through a
//              cursor on the flat buffer; an item is a voxel
//              "cells": with a table beside the buffer that leads to tiles, of 16 bytes a tile at the most
//   trilinear  in the cells of the same voxels, through NanoVDB's sampler and from tiles with halo
//   bounds     smallest, largest and mean value of each tile, for rays, of a buffer with halos
//
// "bytes a voxel" counts active voxels. NanoVDB's conversion takes threads of its own, whatever it is given.
#include "BenchGrids.h"
#include "GeometryVolume/channels/Channel.h"
#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/nanovtt/VTTToNanoVTT.h"
#include "Reader/NanoVTTCursor.h"
#include "Reader/NanoVTTValidate.h"
#include "Render/Bounds.h"

#include <benchmark/benchmark.h>

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <random>

#include <nanovdb/util/OpenToNanoVDB.h>
#include <nanovdb/util/SampleFromVoxels.h>

namespace {

using namespace VLN;

struct Subject {
  std::string name;
  openvdb::FloatGrid::Ptr grid;
  Interop::VdbImport content;
  std::int64_t voxels = 0;
  int rootLevel = 0;

  explicit Subject(Bench::BenchGrid const& source)
      : name(source.name)
      , grid(source.grid)
      , content(Bench::importGrid(source.grid)) {
    using Tree = TileTree3D::Container<TileTree3D::PowerOfTwoTraits>;
    voxels = static_cast<std::int64_t>(grid->activeVoxelCount());
    auto const tree = content.volumes.at(0).object->component<Tree>(Interop::kVdbContainerName);
    rootLevel = Tree::kMaxDepth - tree->cbeginRoots()->second.depth;
  }
  Object const& object() const { return *content.volumes.at(0).object; }
  std::string const& channel() const { return content.volumes.at(0).channels.at(0).name; }
};

template <class BuildT>
nanovtt::GridHandle<nanovtt::AlignedHostBuffer> flatten(Subject const& subject, float halo = 0) {
  nanovtt::AlignedHostBuffer const pool;
  return nanovtt::vttToNanoVTT<nanovtt::AlignedHostBuffer, BuildT, nanovdb::AbsDiff, true>(
      subject.object(), subject.channel(), nanovdb::StatsMode::Disable, nanovdb::ChecksumMode::Disable, 0,
      -1.0f, false, halo, subject.rootLevel, 0, false, false, false, 1, false, false, 0.0f, false, false,
      nullptr, nullptr, nullptr, pool);
}

template <class BuildT> nanovdb::GridHandle<nanovdb::HostBuffer> nanoFlatten(Subject const& subject) {
  using NanoBuild = std::conditional_t<std::is_void_v<BuildT>, float, BuildT>;
  nanovdb::OpenToNanoVDB<float, NanoBuild> convert;
  return convert(*subject.grid, nanovdb::StatsMode::BBox, nanovdb::ChecksumMode::Disable, 0);
}

void report(benchmark::State& state, Subject const& subject, std::uint64_t size) {
  state.SetBytesProcessed(static_cast<std::int64_t>(size) * static_cast<std::int64_t>(state.iterations()));
  state.counters["bytes a voxel"] = double(size) / double(subject.voxels);
  state.counters["MB"] = double(size) / 1e6;
}

template <class BuildT>
void oursBench(benchmark::State& state, Subject const* subject, int threads, float halo) {
  std::uint64_t size = 0;
  withThreads(threads, [&] {
    for (auto _ : state) {
      auto const flat = flatten<BuildT>(*subject, halo);
      size = flat.size();
    }
  });
  report(state, *subject, size);
}

template <class BuildT> void nanoBench(benchmark::State& state, Subject const* subject, int threads) {
  std::uint64_t size = 0;
  withThreads(threads, [&] {
    for (auto _ : state) {
      auto const flat = nanoFlatten<BuildT>(*subject);
      size = flat.size();
    }
  });
  report(state, *subject, size);
}

void memcpyBench(benchmark::State& state, Subject const* subject, int threads) {
  auto const flat = flatten<void>(*subject);
  std::uint64_t const size = flat.size();
  constexpr std::int64_t kPiece = 1 << 20;
  withThreads(threads, [&] {
    for (auto _ : state) {
      auto* const copy = static_cast<std::uint8_t*>(std::aligned_alloc(32, size - size % 32 + 32));
      parallelFor(0, static_cast<std::int64_t>(size),
                  [&](std::int64_t begin, std::int64_t end) {
                    std::memcpy(copy + begin, flat.data() + begin, static_cast<std::size_t>(end - begin));
                  },
                  {.grain = kPiece});
      benchmark::DoNotOptimize(copy);
      std::free(copy);
    }
  });
  report(state, *subject, size);
}

void validateBench(benchmark::State& state, Subject const* subject) {
  auto const flat = flatten<void>(*subject);
  for (auto _ : state) {
    bool ok = nanovtt::validate(flat.data(), flat.size()).ok();
    benchmark::DoNotOptimize(ok);
  }
  report(state, *subject, flat.size());
}

/// A million active voxels of leaves, leaf by leaf, or in any order.
std::vector<openvdb::Coord> voxelsOf(openvdb::FloatGrid const& grid, bool random) {
  constexpr std::size_t kMost = 1 << 20;
  std::vector<openvdb::Coord> voxels;
  for (auto leaf = grid.tree().cbeginLeaf(); leaf; ++leaf)
    for (auto it = leaf->cbeginValueOn(); it; ++it) voxels.push_back(it.getCoord());
  if (random) std::shuffle(voxels.begin(), voxels.end(), std::mt19937(11));
  if (voxels.size() > kMost) voxels.resize(kMost);
  return voxels;
}

template <class Read>
void readBench(benchmark::State& state, Subject const& subject, bool random, Read read) {
  auto const voxels = voxelsOf(*subject.grid, random);
  for (auto _ : state) {
    float sum = 0;
    for (auto const& c : voxels) sum += read(c);
    benchmark::DoNotOptimize(sum);
  }
  state.SetItemsProcessed(static_cast<std::int64_t>(voxels.size()) *
                          static_cast<std::int64_t>(state.iterations()));
}

/// A table of cells with its memory.
struct Cells {
  nanovtt::CellTable table;
  std::vector<std::uint32_t> memory;

  explicit Cells(nanovtt::ContainerReader const& tree)
      : table(tree)
      , memory(table.bytes() / sizeof(std::uint32_t)) {
    table.write(tree, memory.data());
  }
  Cells(Cells const&) = delete;
  Cells& operator=(Cells const&) = delete;
};

void addReads(Subject const* subject) {
  for (bool random : {false, true}) {
    std::string const tail = random ? "random/" : "coherent/";
    auto const add = [&](std::string const& name, auto const& body) {
      benchmark::RegisterBenchmark((subject->name + "/" + name).c_str(), body)->Unit(benchmark::kMillisecond);
    };
    add("read/" + tail + "NanoVDB", [=](benchmark::State& state) {
      auto const flat = nanoFlatten<void>(*subject);
      auto const accessor = flat.grid<float>()->getAccessor();
      readBench(state, *subject, random, [&](openvdb::Coord const& c) {
        return accessor.getValue(nanovdb::Coord(c.x(), c.y(), c.z()));
      });
    });
    add("read/" + tail + "ours", [=](benchmark::State& state) {
      auto const flat = flatten<void>(*subject);
      nanovtt::GridCursor cursor(nanovtt::BufferReader(flat.data()).grid(0));
      readBench(state, *subject, random,
                [&](openvdb::Coord const& c) { return cursor.value(c.x(), c.y(), c.z()); });
    });
    add("read/" + tail + "ours, type known", [=](benchmark::State& state) {
      auto const flat = flatten<void>(*subject);
      nanovtt::Cursor<nanovtt::GridType::kFloat> cursor(nanovtt::BufferReader(flat.data()).grid(0));
      readBench(state, *subject, random,
                [&](openvdb::Coord const& c) { return cursor.value(c.x(), c.y(), c.z()); });
    });
    add("read/" + tail + "ours, type known, cells", [=](benchmark::State& state) {
      auto const flat = flatten<void>(*subject);
      auto const grid = nanovtt::BufferReader(flat.data()).grid(0);
      Cells const cells(grid.container());
      nanovtt::Cursor<nanovtt::GridType::kFloat> cursor(grid, cells.table);
      readBench(state, *subject, random,
                [&](openvdb::Coord const& c) { return cursor.value(c.x(), c.y(), c.z()); });
    });
    add("trilinear/" + tail + "NanoVDB", [=](benchmark::State& state) {
      auto const flat = nanoFlatten<void>(*subject);
      auto const accessor = flat.grid<float>()->getAccessor();
      auto const sampler = nanovdb::createSampler<1>(accessor);
      readBench(state, *subject, random, [&](openvdb::Coord const& c) {
        return sampler(nanovdb::Vec3f(float(c.x()) + 0.25f, float(c.y()) + 0.5f, float(c.z()) + 0.75f));
      });
    });
    add("trilinear/" + tail + "ours, halo tiles", [=](benchmark::State& state) {
      auto const flat = flatten<void>(*subject, 1.0f);
      nanovtt::GridCursor cursor(nanovtt::BufferReader(flat.data()).grid(0));
      readBench(state, *subject, random, [&](openvdb::Coord const& c) {
        return cursor.trilinear(float(c.x()) + 0.25f, float(c.y()) + 0.5f, float(c.z()) + 0.75f);
      });
    });
    add("trilinear/" + tail + "ours, halo tiles, type known", [=](benchmark::State& state) {
      auto const flat = flatten<void>(*subject, 1.0f);
      nanovtt::Cursor<nanovtt::GridType::kFloat> cursor(nanovtt::BufferReader(flat.data()).grid(0));
      readBench(state, *subject, random, [&](openvdb::Coord const& c) {
        return cursor.trilinear(float(c.x()) + 0.25f, float(c.y()) + 0.5f, float(c.z()) + 0.75f);
      });
    });
    add("trilinear/" + tail + "ours, halo tiles, type known, cells", [=](benchmark::State& state) {
      auto const flat = flatten<void>(*subject, 1.0f);
      auto const grid = nanovtt::BufferReader(flat.data()).grid(0);
      Cells const cells(grid.container());
      nanovtt::Cursor<nanovtt::GridType::kFloat> cursor(grid, cells.table);
      readBench(state, *subject, random, [&](openvdb::Coord const& c) {
        return cursor.trilinear(float(c.x()) + 0.25f, float(c.y()) + 0.5f, float(c.z()) + 0.75f);
      });
    });
  }
}

void cellsBench(benchmark::State& state, Subject const* subject) {
  auto const flat = flatten<void>(*subject);
  auto const tree = nanovtt::BufferReader(flat.data()).container();
  for (auto _ : state) benchmark::DoNotOptimize(Cells(tree).memory.data());
  state.counters["MB"] = double(Cells(tree).table.bytes()) / 1e6;
}

// Of a build with codes of 8 bits, which float grids are read from as well.
void addQuantisedReads(Subject const* subject) {
  auto const add = [&](char const* name, float halo, auto read) {
    benchmark::RegisterBenchmark((subject->name + "/" + name).c_str(), [=](benchmark::State& state) {
      auto const flat = flatten<nanovdb::Fp8>(*subject, halo);
      auto const grid = nanovtt::BufferReader(flat.data()).grid(0);
      read(state, grid);
    })->Unit(benchmark::kMillisecond);
  };
  auto const values = [=](auto& cursor, benchmark::State& state) {
    readBench(state, *subject, false,
              [&](openvdb::Coord const& c) { return cursor.value(c.x(), c.y(), c.z()); });
  };
  auto const blends = [=](auto& cursor, benchmark::State& state) {
    readBench(state, *subject, false, [&](openvdb::Coord const& c) {
      return cursor.trilinear(float(c.x()) + 0.25f, float(c.y()) + 0.5f, float(c.z()) + 0.75f);
    });
  };
  using Known = nanovtt::Cursor<nanovtt::GridType::kFp8>;
  add("read/coherent/ours, 8 bits", 0, [=](benchmark::State& state, nanovtt::GridReader const& grid) {
    nanovtt::GridCursor cursor(grid);
    values(cursor, state);
  });
  add("read/coherent/ours, 8 bits, type known", 0,
      [=](benchmark::State& state, nanovtt::GridReader const& grid) {
        Known cursor(grid);
        values(cursor, state);
      });
  add("trilinear/coherent/ours, halo tiles, 8 bits", 1,
      [=](benchmark::State& state, nanovtt::GridReader const& grid) {
        nanovtt::GridCursor cursor(grid);
        blends(cursor, state);
      });
  add("trilinear/coherent/ours, halo tiles, 8 bits, type known", 1,
      [=](benchmark::State& state, nanovtt::GridReader const& grid) {
        Known cursor(grid);
        blends(cursor, state);
      });
}

void addBounds(Subject const* subject) {
  for (int threads : {1, 2})
    benchmark::RegisterBenchmark((subject->name + "/bounds/threads:" + std::to_string(threads)).c_str(),
                                 [=](benchmark::State& state) {
                                   auto const flat = flatten<void>(*subject, 1.0f);
                                   auto const grid = nanovtt::BufferReader(flat.data()).grid(0);
                                   for (auto _ : state)
                                     benchmark::DoNotOptimize(Render::makeBounds(grid, {-1, 16, threads}));
                                   state.counters["tiles"] = grid.container().tileCount();
                                 })
        ->Unit(benchmark::kMillisecond)
        ->MeasureProcessCPUTime()
        ->UseRealTime();
}

template <class BuildT> void addBuild(std::string const& build, Subject const* subject) {
  for (int threads : {1, 2}) {
    std::string const tail = build + "/threads:" + std::to_string(threads);
    benchmark::RegisterBenchmark((subject->name + "/flatten/NanoVDB " + tail).c_str(), nanoBench<BuildT>,
                                 subject, threads)
        ->Unit(benchmark::kMillisecond)
        ->UseRealTime();
    benchmark::RegisterBenchmark((subject->name + "/flatten/ours " + tail).c_str(), oursBench<BuildT>,
                                 subject, threads, 0.0f)
        ->Unit(benchmark::kMillisecond)
        ->UseRealTime();
  }
}

void addAll(Subject const* subject) {
  addReads(subject);
  addQuantisedReads(subject);
  addBounds(subject);
  benchmark::RegisterBenchmark((subject->name + "/cells").c_str(), cellsBench, subject)
      ->Unit(benchmark::kMillisecond);
  benchmark::RegisterBenchmark((subject->name + "/validate").c_str(), validateBench, subject)
      ->Unit(benchmark::kMillisecond);
  addBuild<void>("float", subject);
  for (int threads : {1, 2})
    for (float halo : {0.3f, 1.0f})
      benchmark::RegisterBenchmark((subject->name + "/flatten/ours float, halo " +
                                    std::to_string(halo).substr(0, 3) + "/threads:" + std::to_string(threads))
                                       .c_str(),
                                   oursBench<void>, subject, threads, halo)
          ->Unit(benchmark::kMillisecond)
          ->UseRealTime();
  addBuild<nanovdb::Fp4>("Fp4", subject);
  addBuild<nanovdb::Fp8>("Fp8", subject);
  addBuild<nanovdb::Fp16>("Fp16", subject);
  addBuild<nanovdb::FpN>("FpN", subject);
  for (int threads : {1, 2})
    benchmark::RegisterBenchmark((subject->name + "/memcpy/threads:" + std::to_string(threads)).c_str(),
                                 memcpyBench, subject, threads)
        ->Unit(benchmark::kMillisecond)
        ->UseRealTime();
}

} // namespace

int main(int argc, char** argv) {
  for (auto const& grid : Bench::benchGrids()) addAll(new Subject(grid));
  // On request, for it takes gigabytes: a level set of 50 million voxels.
  if (std::getenv("VLN_BENCH_LARGE")) {
    auto const large =
        openvdb::tools::createLevelSetSphere<openvdb::FloatGrid>(820.0f, openvdb::Vec3f(0), 1.0f, 3.0f);
    large->setName("sphere");
    addAll(new Subject({"sphere_820", large}));
  }
  benchmark::Initialize(&argc, argv);
  if (benchmark::ReportUnrecognizedArguments(argc, argv)) return 1;
  benchmark::RunSpecifiedBenchmarks();
  return 0;
}
