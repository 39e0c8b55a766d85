// The grids that benchmarks run on: real ones out of a folder, as far as they are there, and a generated one.
#pragma once

#include "Interop/VdbFileImpl.h"
#include "Interop/VdbImportImpl.h"

#include <openvdb/tools/LevelSetSphere.h>

#include <filesystem>
#include <string>
#include <vector>

namespace VLN::Bench {

struct BenchGrid {
  std::string name;
  openvdb::FloatGrid::Ptr grid;
};

/// The first float grid of a file, with every voxel in memory: OpenVDB loads leaves late.
inline openvdb::FloatGrid::Ptr readFloatGrid(std::string const& path) {
  for (auto const& candidate : Interop::readVdbFile(path).grids)
    if (candidate->isType<openvdb::FloatGrid>()) {
      auto const grid = openvdb::gridPtrCast<openvdb::FloatGrid>(candidate);
      grid->tree().readNonresidentBuffers();
      return grid;
    }
  return nullptr;
}

/// VLN_BENCH_DATA_DIR is the folder of volumes, empty without one.
inline std::vector<BenchGrid> const& benchGrids() {
  static std::vector<BenchGrid> const* const grids = [] {
    openvdb::initialize();
    auto* const list = new std::vector<BenchGrid>;
    std::string const folder = VLN_BENCH_DATA_DIR;
    for (char const* name : {"bunny_ls_512_half", "smoke"}) {
      std::filesystem::path const file = std::filesystem::path(folder) / "vdb" / (std::string(name) + ".vdb");
      std::error_code unknown;
      if (!folder.empty() && std::filesystem::exists(file, unknown))
        list->push_back({name, readFloatGrid(file.string())});
    }
    auto const sphere =
        openvdb::tools::createLevelSetSphere<openvdb::FloatGrid>(200.0f, openvdb::Vec3f(0), 1.0f, 3.0f);
    sphere->setName("sphere");
    list->push_back({"sphere_200", sphere});
    return list;
  }();
  return *grids;
}

/// The volume of one grid.
inline Interop::VdbImport importGrid(openvdb::GridBase::Ptr const& grid) {
  Interop::VdbFile file;
  file.grids = {grid};
  return Interop::importGrids(file);
}

} // namespace VLN::Bench
