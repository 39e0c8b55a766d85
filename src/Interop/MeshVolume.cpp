#include "Interop/FileError.h"
#include "Interop/Mesh.h"
#include "Interop/OutputFile.h"
#include "Interop/VdbExportImpl.h"
#include "Interop/VdbImportImpl.h"

#include "GeometryVolume/pools/ChannelPool.h"

#include <openvdb/tools/MeshToVolume.h>
#include <openvdb/tools/VolumeToMesh.h>

#include <algorithm>
#include <cmath>
#include <cstring>

namespace VLN::Interop {

namespace {

using Velorn::Math::double3;

constexpr double kVoxelsAcross = 256; ///< of the longest side, where no size is said
constexpr double kBytesPerVoxel = 40; ///< of the band, measured with the voxels that leaves have beside it
constexpr double kReach = 0x1p28;     ///< of an index, well within the tree's domain

/// As meshToVolume() takes it: in index space, in doubles.
struct Adapter {
  Mesh const& mesh;
  double scale;

  std::size_t polygonCount() const { return mesh.triangles.size(); }
  std::size_t pointCount() const { return mesh.points.size(); }
  std::size_t vertexCount(std::size_t) const { return 3; }
  void getIndexSpacePoint(std::size_t n, std::size_t corner, openvdb::Vec3d& to) const {
    double3 const& p = mesh.points[mesh.triangles[n][corner]];
    to = openvdb::Vec3d(p.x, p.y, p.z) * scale;
  }
};

double longestSide(Mesh const& mesh) {
  double longest = 0;
  for (int a = 0; a < 3; ++a) {
    double low = mesh.points[mesh.triangles[0][0]][a], high = low;
    for (auto const& t : mesh.triangles)
      for (auto const n : t) low = std::min(low, mesh.points[n][a]), high = std::max(high, mesh.points[n][a]);
    longest = std::max(longest, high - low);
  }
  return longest;
}

double areaOf(Mesh const& mesh) {
  double area = 0;
  for (auto const& t : mesh.triangles) {
    double3 const u = mesh.points[t[1]] - mesh.points[t[0]], v = mesh.points[t[2]] - mesh.points[t[0]];
    area += std::hypot(u.y * v.z - u.z * v.y, u.z * v.x - u.x * v.z, u.x * v.y - u.y * v.x) / 2;
  }
  return area;
}

double voxelSizeFor(std::string const& path, Mesh const& mesh, MeshOptions const& options, double memory) {
  double const longest = longestSide(mesh);
  double const size = options.voxelSize > 0 ? options.voxelSize : longest / kVoxelsAcross;
  if (!(size > 0) || !std::isnormal(static_cast<float>(size)) || !std::isfinite(longest))
    throw FileError(path, "has no extent that voxels could be chosen for: say --voxel-size");
  for (double3 const& p : mesh.points)
    for (int a = 0; a < 3; ++a)
      if (!(std::abs(p[a]) / size < kReach))
        throw FileError(path, "lies too far from the origin for voxels of that size");
  double const voxels = (areaOf(mesh) / (size * size) + double(mesh.triangles.size())) * 2 * options.band;
  if (!(voxels * kBytesPerVoxel < memory))
    throw FileError(path, "its band of voxels of that size needs more than " +
                              std::to_string(static_cast<std::int64_t>(memory / 1e6)) + " MB of memory");
  return size;
}

openvdb::FloatGrid::Ptr onlyFloats(VdbImport const& content) {
  auto const grids = exportedGrids(content);
  if (grids.size() != 1)
    throw FileError(content.file, "has " + std::to_string(grids.size()) +
                                      " grids, and a surface is made of one: choose with --channels");
  if (auto floats = openvdb::gridPtrCast<openvdb::FloatGrid>(grids[0])) return floats;
  if (auto const doubles = openvdb::gridPtrCast<openvdb::DoubleGrid>(grids[0]))
    return std::make_shared<openvdb::FloatGrid>(*doubles);
  throw FileError(content.file, "a surface is made of a grid of floats, and this one is of type " +
                                    oneLine(grids[0]->valueType(), 40));
}

/// Appends the bytes of a value.
template <class T> void append(std::string& to, T const& value) {
  to.append(reinterpret_cast<char const*>(&value), sizeof value);
}

} // namespace

VdbImport importMesh(std::string const& path, MeshOptions const& options, VdbReadLimits const& limits,
                     Progress const& progress) {
  if (progress) progress("reading", 0);
  openvdb::initialize();
  Mesh const mesh = readMesh(path);
  std::uint64_t memory = limits.memoryBytes;
  if (memory == 0) memory = TileTree3D::ChannelPool::availablePhysicalMemory() / 4 * 3;
  if (memory == 0) memory = ~std::uint64_t(0);
  double const size = voxelSizeFor(path, mesh, options, double(memory));
  if (progress) progress("measuring distances", 0.1);
  auto const transform = openvdb::math::Transform::createLinearTransform(size);
  auto const band = static_cast<float>(options.band);
  VdbFile file;
  file.path = path;
  file.memoryBytes = memory;
  auto const grid =
      openvdb::tools::meshToVolume<openvdb::FloatGrid>(Adapter{mesh, 1 / size}, *transform, band, band);
  grid->setName("surface");
  grid->setGridClass(openvdb::GRID_LEVEL_SET);
  file.grids.push_back(grid);
  return importGrids(file, limits, progress);
}

void exportSurface(VdbImport const& content, std::string const& path, SurfaceOptions const& options,
                   Progress const& progress) {
  openvdb::initialize();
  OutputFile out(path);
  auto const grid = onlyFloats(content);
  if (progress) progress("finding the surface", 0.3);
  std::vector<openvdb::Vec3s> points;
  std::vector<openvdb::Vec3I> triangles;
  std::vector<openvdb::Vec4I> quads;
  openvdb::tools::volumeToMesh(*grid, points, triangles, quads, options.iso, options.adaptivity);
  if (triangles.empty() && quads.empty())
    throw FileError(content.file, "has no surface: no value of it is " + std::to_string(options.iso));
  if (progress) progress("writing", 0.8);
  std::string text = "ply\nformat binary_little_endian 1.0\nelement vertex " + std::to_string(points.size()) +
                     "\nproperty float x\nproperty float y\nproperty float z\nelement face " +
                     std::to_string(triangles.size() + quads.size()) +
                     "\nproperty list uchar int vertex_indices\nend_header\n";
  auto const flush = [&](std::size_t most) {
    if (text.size() <= most) return;
    out.write(text);
    text.clear();
  };
  constexpr std::size_t kAtOnce = 1 << 20;
  for (auto const& p : points) {
    for (int a = 0; a < 3; ++a) append(text, p[a]);
    flush(kAtOnce);
  }
  // OpenVDB's faces are seen from the side of smaller values.
  auto const face = [&](auto const& corners, int count) {
    append(text, static_cast<unsigned char>(count));
    for (int n = count - 1; n >= 0; --n) append(text, static_cast<std::int32_t>(corners[n]));
    flush(kAtOnce);
  };
  for (auto const& t : triangles) face(t, 3);
  for (auto const& q : quads) face(q, 4);
  flush(0);
  out.commit();
  if (progress) progress("done", 1);
}

} // namespace VLN::Interop
