#include "GeometryVolume/tiletree/Container.h"
#include "Interop/FileError.h"
#include "Interop/OutputFile.h"
#include "Interop/VdbImport.h"
#include "vln/Commands.h"
#include "vln/PointsFile.h"
#include "vln/ProgressBar.h"

#include <chrono>
#include <filesystem>
#include <iostream>

#include <fmt/format.h>
#include <nlohmann/json.hpp>

namespace Vln {

namespace {

using namespace VLN::Interop;
using Json = nlohmann::ordered_json;

std::int64_t pointCount(PointVolume const& volume) {
  return static_cast<std::int64_t>(volume.object->component(kPositionsName)->size());
}
std::int64_t tileCount(PointVolume const& volume) {
  return volume.object->component<PointContainer>(kPointContainerName)->tileCount(-1);
}

} // namespace

void points(PointsOptions const& options) {
  checkPointsOutput(options.output);
  PointVolume volume;
  {
    ProgressBar bar;
    volume = readPointVolume(options.input, bar.progress());
    bar.show("writing", 0.7);
    writePoints(options.output, volume, options.size);
  }
  noteLosses(options.input.file, volume);
  std::cout << fmt::format("{} points in {} tiles, voxel size {:.6g}\n", pointCount(volume),
                           tileCount(volume), volume.voxelSize);
}

void tiles(TilesOptions const& options) {
  checkOutput(options.output);
  Ostil::Ptr<PointContainer> tree;
  {
    ProgressBar bar;
    if (isPointsFile(options.input.file)) {
      PointVolume const volume = readPointVolume(options.input, bar.progress());
      tree = Ostil::makePtr<PointContainer>(*volume.object->component<PointContainer>(kPointContainerName));
      tree->setVoxelSize(static_cast<float>(volume.voxelSize));
    } else {
      auto const content = importVdb(options.input.file, options.input.limits, bar.progress());
      if (!content.volumes.empty()) {
        tree = content.volumes.front().object->component<PointContainer>(kVdbContainerName);
      } else {
        PointVolume const volume = readPointVolume(options.input, bar.progress());
        tree = Ostil::makePtr<PointContainer>(*volume.object->component<PointContainer>(kPointContainerName));
        tree->setVoxelSize(static_cast<float>(volume.voxelSize));
      }
    }
    OutputFile file(options.output);
    // The materials go to the current folder: they belong beside the file that names them.
    auto const output = std::filesystem::absolute(file.temporaryPath());
    auto const here = std::filesystem::current_path();
    std::filesystem::current_path(output.parent_path());
    tree->dumpObj(output.string(), options.depth);
    std::filesystem::current_path(here);
    file.commit();
  }
  std::cout << fmt::format("{} tiles of depth {}\n", tree->tileCount(options.depth), options.depth);
}

void advect(AdvectOptions const& options) {
  if (!options.output.empty()) checkPointsOutput(options.output);
  PointVolume volume;
  std::int64_t before = 0, tilesBefore = 0, gained = 0, lost = 0;
  double seconds = 0;
  {
    ProgressBar bar;
    volume = readPointVolume(options.input, bar.progress());
    before = pointCount(volume), tilesBefore = tileCount(volume);
    Velorn::Math::double3 const velocity{options.velocity[0], options.velocity[1], options.velocity[2]};
    for (int n = 0; n < options.steps; ++n) {
      bar.show("moving the points", double(n) / options.steps);
      auto const start = std::chrono::steady_clock::now();
      auto const statistics = VLN::Interop::advect(volume, velocity);
      seconds += std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
      gained += statistics.tilesGained, lost += statistics.tilesLost;
    }
    if (!options.output.empty()) {
      bar.show("writing", 1);
      writePoints(options.output, volume, 0);
    }
  }
  noteLosses(options.input.file, volume);
  std::int64_t const after = pointCount(volume);
  if (options.json) {
    std::cout << Json({{"points_before", before},
                       {"points_after", after},
                       {"dropped", before - after},
                       {"steps", options.steps},
                       {"seconds", seconds},
                       {"tiles_before", tilesBefore},
                       {"tiles_after", tileCount(volume)}})
                     .dump(2)
              << "\n";
    return;
  }
  double const rate = seconds > 0 ? double(before) * options.steps / seconds : 0;
  std::cout << fmt::format("{} points, {} steps in {:.3f} s: {:.1f} million points a second\n"
                           "{} points after, {} dropped\n"
                           "{} tiles before, {} gained, {} lost, {} after\n",
                           before, options.steps, seconds, rate / 1e6, after, before - after, tilesBefore,
                           gained, lost, tileCount(volume));
}

} // namespace Vln
