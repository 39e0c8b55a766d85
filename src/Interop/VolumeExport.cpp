#include "Interop/VolumeExport.h"

#include "Interop/DenseWrite.h"
#include "Interop/FileError.h"
#include "Interop/FileFormat.h"
#include "Interop/NvdbFile.h"
#include "Interop/OmeZarrWrite.h"
#include "Interop/UsdaWrite.h"
#include "Interop/VdbExport.h"
#include "Interop/VdbRecord.h"
#include "Interop/VtkHdfWrite.h"

namespace VLN::Interop {

namespace {

/// Of formats that hold one volume.
DenseVolume onlyVolume(VdbImport const& content) {
  if (content.volumes.empty()) throw FileError(content.file, "has no volume that could be written");
  if (content.volumes.size() > 1)
    throw FileError(content.file, "holds " + std::to_string(content.volumes.size()) +
                                      " volumes, each with a transform of its own: choose with --channels");
  return denseVolumeOf(content.volumes.front());
}

/// Of formats in which each has a transform of its own.
std::vector<DenseVolume> allVolumes(VdbImport const& content) {
  if (content.volumes.empty()) throw FileError(content.file, "has no volume that could be written");
  std::vector<DenseVolume> volumes;
  for (auto const& volume : content.volumes) volumes.push_back(denseVolumeOf(volume));
  return volumes;
}

/// Of formats that hold grids: what tells them is not in a flat buffer.
VdbImport const& grids(VdbImport const& content) {
  for (auto const& volume : content.volumes)
    if (!volume.object->hasProperty(kVdbGridsProperty))
      throw FileError(content.file, "is a flat buffer, which has no grids: what is active is not in it");
  return content;
}

} // namespace

void exportVolumes(VdbImport const& content, std::string const& path, Progress const& progress,
                   ExportOptions const& options) {
  switch (checkOutputFor(FileContent::kExports, path)) {
  case FileFormat::kNpz:
    if (!options.voxelByVoxel) return writeNpz(path, onlyVolume(content), progress);
    onlyVolume(content);
    return writeNpzVoxels(path, grids(content), progress);
  case FileFormat::kNvdb:
    return exportNvdb(grids(content), path, progress);
  case FileFormat::kPly:
    return exportSurface(grids(content), path, options.surface, progress);
  case FileFormat::kUsda:
    return writeUsda(path, grids(content), progress);
  case FileFormat::kVti:
    return writeVti(path, onlyVolume(content), progress);
  case FileFormat::kVtkHdf:
    return writeVtkHdf(path, onlyVolume(content), progress);
  case FileFormat::kZarr:
    return writeOmeZarr(path, allVolumes(content), progress);
  default:
    return exportVdb(grids(content), path, progress);
  }
}

void exportVolumesReleasing(VdbImport& content, std::string const& path, Progress const& progress,
                            ExportOptions const& options) {
  if (checkOutputFor(FileContent::kExports, path) != FileFormat::kVdb)
    return exportVolumes(content, path, progress, options);
  grids(content);
  exportVdbReleasing(content, path, progress);
}

} // namespace VLN::Interop
