#include "Commands.h"
#include "GeometryVolume/tiletree/Container.h"
#include "Interop/FileError.h"
#include "Interop/FileFormat.h"
#include "Interop/Obj.h"
#include "Interop/VdbImport.h"
#include "PointsFile.h"
#include "ProgressBar.h"
#include "StandardOutput.h"

#include <chrono>
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

// What --grid names is a grid, and the tree is that of all grids of its object.
std::vector<PlacedTree> treesOf(PointsInput const& input, Progress const& progress) {
  std::vector<PlacedTree> trees;
  auto const addPoints = [&](PointVolume const& volume) {
    trees.push_back({volume.name.empty() ? "points" : volume.name,
                     volume.object->component<PointContainer>(kPointContainerName),
                     IndexToWorld(volume.voxelSize, volume.origin)});
  };
  auto const wanted = [&](std::string const& name) { return input.grid.empty() || name == input.grid; };
  if (isPointsFile(input.file)) {
    addPoints(readPointVolume(input, progress));
    return trees;
  }
  auto const content = importVdb(input.file, input.limits, progress);
  for (auto const& volume : content.volumes)
    for (auto const& channel : volume.channels)
      if (wanted(channel.gridName)) {
        trees.push_back(
            {channel.name, volume.object->component<PointContainer>(kVdbContainerName), volume.indexToWorld});
        break;
      }
  for (auto const& volume : content.points)
    if (wanted(volume.name)) addPoints(volume);
  if (trees.empty())
    throw FileError(input.file, input.grid.empty() ? "has no grid that could be drawn"
                                                   : "has no grid '" + input.grid + "'");
  return trees;
}

} // namespace

void points(PointsOptions const& options) {
  checkPointsOutput(options.output);
  PointVolume volume;
  {
    ProgressBar bar;
    volume = readPointVolume(options.input, bar.progress(0, 0.7));
    bar.show("writing", 0.7);
    writePoints(options.output, volume, options.size);
  }
  noteLosses(options.input.file, volume);
  remarks(options.output) << fmt::format("{} points in {} tiles, voxel size {:.6g}\n", pointCount(volume),
                                         tileCount(volume), volume.voxelSize);
}

void tiles(TilesOptions const& options) {
  checkOutputFor(FileContent::kBoxes, options.output);
  std::int64_t count = 0;
  {
    ProgressBar bar;
    auto const trees = treesOf(options.input, bar.progress(0, 0.9));
    bar.show("writing", 0.9);
    count = writeTilesObj(options.output, trees, options.depth);
  }
  remarks(options.output) << fmt::format("{} tiles of depth {}\n", count, options.depth);
}

void advect(AdvectOptions const& options) {
  if (!options.output.empty()) checkPointsOutput(options.output);
  PointVolume volume;
  std::int64_t before = 0, tilesBefore = 0, gained = 0, lost = 0;
  double seconds = 0;
  {
    ProgressBar bar;
    volume = readPointVolume(options.input, bar.progress(0, 0.3));
    before = pointCount(volume), tilesBefore = tileCount(volume);
    Velorn::Math::double3 const velocity{options.velocity[0], options.velocity[1], options.velocity[2]};
    for (int n = 0; n < options.steps; ++n) {
      bar.show("moving the points", 0.3 + 0.6 * n / options.steps);
      auto const start = std::chrono::steady_clock::now();
      auto const statistics = VLN::Interop::advect(volume, velocity);
      seconds += std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
      gained += statistics.tilesGained, lost += statistics.tilesLost;
    }
    if (!options.output.empty()) {
      bar.show("writing", 0.9);
      writePoints(options.output, volume, 0);
    }
  }
  noteLosses(options.input.file, volume);
  std::int64_t const after = pointCount(volume);
  auto& report = remarks(options.output);
  if (options.json) {
    report << Json({{"points_before", before},
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
  report << fmt::format("{} points, {} steps in {:.3f} s: {:.1f} million points a second\n"
                        "{} points after, {} dropped\n"
                        "{} tiles before, {} gained, {} lost, {} after\n",
                        before, options.steps, seconds, rate / 1e6, after, before - after, tilesBefore,
                        gained, lost, tileCount(volume));
}

} // namespace Vln
