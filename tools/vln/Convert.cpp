#include "Commands.h"
#include "Content.h"
#include "Interop/FileError.h"
#include "Interop/FileFormat.h"
#include "Interop/OutputFile.h"
#include "Interop/VolumeExport.h"
#include "Interop/VolumeFile.h"
#include "PointsFile.h"
#include "ProgressBar.h"
#include "StandardOutput.h"

#include <iostream>

#include <fmt/format.h>

namespace Vln {

using namespace VLN::Interop;

namespace {

std::string whyNot(VdbImport const& content) {
  std::string reasons;
  for (auto const& s : content.skipped) reasons += "; '" + oneLine(s.grid, 60) + "': " + oneLine(s.reason);
  return reasons;
}

// With --strict all that would be left out is an error.
void checkWhole(VdbImport const& content) {
  if (!content.skipped.empty()) throw FileError(content.file, "would not be written whole" + whyNot(content));
  for (auto const& points : content.points)
    if (std::string const loss = lossesOf(points); !loss.empty())
      throw FileError(content.file,
                      "would not be written whole; '" + oneLine(points.name, 60) + "': " + loss);
}

} // namespace

void convert(ConvertOptions const& options) {
  FileFormat const format = checkOutputFor(FileContent::kExports, options.output);
  if (options.sparse && format != FileFormat::kNpz)
    throw FileError(options.output, "--sparse is for .npz files");
  bool const holdsPoints = isWritten(format, FileContent::kPointData);
  VdbImport content;
  std::size_t written = 0;
  {
    ProgressBar bar;
    content =
        importVolumes(options.file, options.limits, bar.progress(0, 0.7), {options.voxelSize, options.band});
    if (holdsPoints) written = content.points.size();
    for (auto const& volume : content.volumes) written += volume.channels.size();
    if (written == 0) throw FileError(options.file, "has no grid that could be written" + whyNot(content));
    if (options.strict) checkWhole(content);
    if (options.strict && !holdsPoints && !content.points.empty())
      throw FileError(content.file,
                      "would not be written whole: it has points, which such files do not hold");
    exportVolumesReleasing(content, options.output, bar.progress(0.7, 1),
                           {.surface = {options.iso, options.adaptivity}, .voxelByVoxel = options.sparse});
  }
  for (auto const& s : content.skipped)
    std::cerr << fmt::format("vln: {}: note: '{}' is left out: {}\n", options.file, oneLine(s.grid, 60),
                             oneLine(s.reason));
  for (auto const& points : content.points) noteLosses(options.file, points);
  remarks(options.output) << fmt::format("{}: {} {} written\n", options.output, written,
                                         written == 1 ? "grid" : "grids");
  leaveToSystem(std::move(content));
}

} // namespace Vln
