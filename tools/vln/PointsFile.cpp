#include "PointsFile.h"

#include "Interop/FileError.h"
#include "Interop/FileFormat.h"
#include "Interop/Obj.h"
#include "Interop/Ply.h"
#include "Interop/VdbPoints.h"

#include <iostream>

#include <fmt/format.h>

namespace Vln {

using namespace VLN::Interop;

bool isPointsFile(std::string const& path) { return formatOf(path) == FileFormat::kPly; }

std::vector<PointVolume> readPointVolumes(PointsInput const& input, Progress const& progress) {
  if (!isPointsFile(input.file)) return importVdbPoints(input.file, input.limits, progress);
  if (progress) progress("reading", 0);
  PointSet const set = readPly(input.file, {input.voxelSize, input.pointsPerTile});
  if (progress) progress("building the tree", 0.5);
  std::vector<PointVolume> volumes;
  volumes.push_back(buildPointVolume(set));
  return volumes;
}

PointVolume readPointVolume(PointsInput const& input, Progress const& progress) {
  auto volumes = readPointVolumes(input, progress);
  if (!input.grid.empty()) {
    for (PointVolume& volume : volumes)
      if (volume.name == input.grid) return std::move(volume);
    throw FileError(input.file, "has no points grid '" + input.grid + "'");
  }
  if (volumes.empty()) throw FileError(input.file, "has no points grid");
  if (volumes.size() > 1) throw FileError(input.file, "has more than one points grid: name one with --grid");
  return std::move(volumes.front());
}

std::string lossesOf(PointVolume const& volume) {
  std::string losses;
  auto const add = [&](std::string const& loss) { losses += (losses.empty() ? "" : "; ") + loss; };
  if (volume.dropped > 0) add(fmt::format("{} points lie out of reach and are left out", volume.dropped));
  for (auto const& name : volume.skippedAttributes)
    add(fmt::format("the attribute {} is left out", oneLine(name, 60)));
  return losses;
}

void noteLosses(std::string const& file, PointVolume const& volume) {
  if (std::string const losses = lossesOf(volume); !losses.empty())
    std::cerr << fmt::format("vln: {}: note: {}\n", file, losses);
}

void checkPointsOutput(std::string const& path) { checkOutputFor(FileContent::kPoints, path); }

void writePoints(std::string const& path, PointVolume const& volume, double size) {
  switch (formatOf(path)) {
  case FileFormat::kPly:
    writePly(path, pointSetOf(volume));
    break;
  case FileFormat::kVdb:
    writeVdbPoints(path, pointSetOf(volume), volume.name.empty() ? "points" : volume.name);
    break;
  default:
    writePointsObj(path, volume, size > 0 ? size : 0.25 * volume.voxelSize);
  }
}

} // namespace Vln
