// In place of NvdbFile.cpp and MeshVolume.cpp in builds without VLN_WITH_CONVERTERS.
#include "Interop/FileError.h"
#include "Interop/FileFormat.h"
#include "Interop/Mesh.h"
#include "Interop/NvdbFile.h"

namespace VLN::Interop {

namespace {

[[noreturn]] void leftOut(std::string const& path, char const* what) {
  throw FileError(path, std::string("this build ") + what + ": it was made without VLN_WITH_CONVERTERS");
}

} // namespace

bool isNvdbFile(std::string const& path) { return formatOf(path) == FileFormat::kNvdb; }
VdbImport importNvdb(std::string const& path, VdbReadLimits const&, Progress const&) {
  leftOut(path, "reads no .nvdb files");
}
void exportNvdb(VdbImport const&, std::string const& path, Progress const&) {
  leftOut(path, "writes no .nvdb files");
}
VdbImport importMesh(std::string const& path, MeshOptions const&, VdbReadLimits const&, Progress const&) {
  leftOut(path, "makes no volumes of meshes");
}
void exportSurface(VdbImport const&, std::string const& path, SurfaceOptions const&, Progress const&) {
  leftOut(path, "writes no surfaces");
}

} // namespace VLN::Interop
