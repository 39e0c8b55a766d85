#include "PointsFile.h"

#include "Interop/FileError.h"
#include "Interop/Obj.h"
#include "Interop/OutputFile.h"
#include "Interop/Ply.h"
#include "Interop/VdbPoints.h"

#include <algorithm>
#include <cctype>
#include <filesystem>
#include <iostream>

#include <fmt/format.h>

namespace Vln {

using namespace VLN::Interop;

std::string extensionOf(std::string const& path) {
  std::string extension = std::filesystem::path(path).extension().string();
  std::transform(extension.begin(), extension.end(), extension.begin(),
                 [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
  return extension;
}

bool isPointsFile(std::string const& path) { return extensionOf(path) == ".ply"; }

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

void noteLosses(std::string const& file, PointVolume const& volume) {
  if (volume.dropped > 0)
    std::cerr << fmt::format("vln: {}: note: {} points lie out of reach and are left out\n", file,
                             volume.dropped);
  for (auto const& name : volume.skippedAttributes)
    std::cerr << fmt::format("vln: {}: note: the attribute {} is left out\n", file, oneLine(name, 60));
  if (!volume.transform.empty())
    std::cerr << fmt::format(
        "vln: {}: note: the transform is {}; positions leave out all but the voxel size\n", file,
        volume.transform);
}

void checkPointsOutput(std::string const& path) {
  std::string const extension = extensionOf(path);
  if (extension != ".obj" && extension != ".ply" && extension != ".vdb")
    throw FileError(path, "points are written as .obj, .ply or .vdb");
  checkOutput(path);
}

void writePoints(std::string const& path, PointVolume const& volume, double size) {
  std::string const extension = extensionOf(path);
  if (extension == ".ply") {
    writePly(path, pointSetOf(volume));
  } else if (extension == ".vdb") {
    writeVdbPoints(path, pointSetOf(volume), volume.name.empty() ? "points" : volume.name);
  } else {
    writePointsObj(path, volume, size > 0 ? size : 0.25 * volume.voxelSize);
  }
}

} // namespace Vln
