#include "Interop/Mesh.h"

#include "Interop/ChannelValues.h"
#include "Interop/FileError.h"
#include "Interop/VdbExport.h"
#include "Interop/VdbMake.h"
#include "Interop/VolumeFile.h"
#include "support/ReadAll.h"
#include "support/TempFolder.h"

#include <gtest/gtest.h>

#include <cmath>
#include <cstring>
#include <filesystem>
#include <limits>
#include <map>
#include <sstream>

namespace VLN::Test {
namespace {

using namespace VLN::Interop;
using Velorn::Math::double3;

double distance(double3 const& p) { return std::hypot(p.x, p.y, p.z); }

/// A sphere of triangles: an octahedron, halved again and again.
Mesh sphere(double radius, double3 const& center, int halvings) {
  Mesh mesh;
  mesh.points = {{1, 0, 0}, {-1, 0, 0}, {0, 1, 0}, {0, -1, 0}, {0, 0, 1}, {0, 0, -1}};
  mesh.triangles = {{0, 2, 4}, {2, 1, 4}, {1, 3, 4}, {3, 0, 4}, {2, 0, 5}, {1, 2, 5}, {3, 1, 5}, {0, 3, 5}};
  for (int n = 0; n < halvings; ++n) {
    std::map<std::pair<std::uint32_t, std::uint32_t>, std::uint32_t> middles;
    auto const middle = [&](std::uint32_t a, std::uint32_t b) {
      auto const [found, fresh] = middles.insert({{std::min(a, b), std::max(a, b)}, 0});
      if (fresh) {
        double3 m = mesh.points[a] + mesh.points[b];
        found->second = static_cast<std::uint32_t>(mesh.points.size());
        mesh.points.push_back(m * (1 / distance(m)));
      }
      return found->second;
    };
    std::vector<std::array<std::uint32_t, 3>> finer;
    for (auto const& [a, b, c] : mesh.triangles) {
      auto const ab = middle(a, b), bc = middle(b, c), ca = middle(c, a);
      finer.insert(finer.end(), {{a, ab, ca}, {ab, b, bc}, {ca, bc, c}, {ab, bc, ca}});
    }
    mesh.triangles = finer;
  }
  for (auto& p : mesh.points) p = center + p * radius;
  return mesh;
}

std::string obj(Mesh const& mesh) {
  std::ostringstream out;
  out.precision(17);
  out << "# a sphere\no sphere\n";
  for (auto const& p : mesh.points) out << "v " << p.x << " " << p.y << " " << p.z << "\r\n";
  // Normals and counting from the end come too.
  for (std::size_t n = 0; n < mesh.triangles.size(); ++n) {
    auto const& t = mesh.triangles[n];
    auto const count = static_cast<long>(mesh.points.size());
    if (n % 2)
      out << "f " << t[0] + 1 << "//7 " << t[1] + 1 << "/1/7 " << t[2] + 1 << "\n";
    else
      out << "f " << long(t[0]) - count << " " << long(t[1]) - count << " " << long(t[2]) - count << "\n";
  }
  return out.str();
}

template <class T> void append(std::string& to, T const& value) {
  to.append(reinterpret_cast<char const*>(&value), sizeof value);
}

std::string stl(Mesh const& mesh) {
  std::string bytes = "solid, and yet binary";
  bytes.resize(80, ' ');
  append(bytes, static_cast<std::uint32_t>(mesh.triangles.size()));
  for (auto const& t : mesh.triangles) {
    bytes.append(12, '\0');
    for (auto const n : t)
      for (int a = 0; a < 3; ++a) append(bytes, static_cast<float>(mesh.points[n][a]));
    bytes.append(2, '\0');
  }
  return bytes;
}

std::string stlText(Mesh const& mesh) {
  std::ostringstream out;
  out.precision(17);
  out << "solid sphere\n";
  for (auto const& t : mesh.triangles) {
    out << " facet normal 0 0 0\n  outer loop\n";
    for (auto const n : t)
      out << "   vertex " << mesh.points[n].x << " " << mesh.points[n].y << " " << mesh.points[n].z << "\n";
    out << "  endloop\n endfacet\n";
  }
  out << "endsolid sphere\n";
  return out.str();
}

std::string ply(Mesh const& mesh) {
  std::ostringstream out;
  out.precision(17);
  out << "ply\nformat ascii 1.0\nelement vertex " << mesh.points.size()
      << "\nproperty double x\nproperty double y\nproperty double z\nproperty uchar red\nelement face "
      << mesh.triangles.size()
      << "\nproperty uchar flags\nproperty list uchar int vertex_indices\nend_header\n";
  for (auto const& p : mesh.points) out << p.x << " " << p.y << " " << p.z << " 255\n";
  for (auto const& t : mesh.triangles) out << "0 3 " << t[0] << " " << t[1] << " " << t[2] << "\n";
  return out.str();
}

std::string told(auto const& call) {
  try {
    call();
  } catch (FileError const& error) { return error.reason(); }
  return "";
}

double valueAt(ChannelValues const& values, Velorn::Math::int3 const& voxel) {
  double value = 0;
  values.at(voxel, &value);
  return value;
}

/// The largest difference between the band's values and the distance to a sphere, in voxels. Beyond
/// the band stands its width, from a fifth of a voxel before its end at the earliest: the band is made voxel
/// by voxel.
double worst(VdbVolume const& volume, double radius, double3 const& center) {
  auto const& channel = volume.channels.at(0);
  auto const values = ChannelValues::of(volume, channel.name);
  double const band = 3 * volume.voxelSize;
  double largest = 0;
  std::int64_t inBand = 0;
  for (int z = channel.activeBox.min.z; z < channel.activeBox.max.z; ++z)
    for (int y = channel.activeBox.min.y; y < channel.activeBox.max.y; ++y)
      for (int x = channel.activeBox.min.x; x < channel.activeBox.max.x; ++x) {
        double const d =
            distance(volume.indexToWorld.toWorld({double(x), double(y), double(z)}) - center) - radius;
        double const value = valueAt(*values, {x, y, z});
        if (std::abs(value) < 0.9999 * band) {
          largest = std::max(largest, std::abs(value - d));
        } else {
          EXPECT_GT(std::abs(d), band - 0.2 * volume.voxelSize);
          EXPECT_EQ(value < 0, d < 0);
        }
        inBand += std::abs(d) < band;
      }
  EXPECT_NEAR(double(channel.activeVoxels), double(inBand), 0.05 * double(inBand));
  return largest / volume.voxelSize;
}

TEST(MeshTest, RequirementDistancesAreThoseToTheSphere) {
  TempFolder const folder;
  double3 const center{10, -20.5, 3};
  double const radius = 2;
  Mesh const mesh = sphere(radius, center, 6);
  writeAll(folder / "a.obj", obj(mesh));
  writeAll(folder / "b.stl", stl(mesh));
  writeAll(folder / "c.stl", stlText(mesh));
  writeAll(folder / "d.ply", ply(mesh));
  MeshOptions options;
  options.voxelSize = 0.1;
  for (char const* name : {"a.obj", "b.stl", "c.stl", "d.ply"}) {
    SCOPED_TRACE(name);
    auto const content = importVolumes(folder / name, {}, {}, options);
    ASSERT_EQ(content.volumes.size(), 1u);
    EXPECT_EQ(content.volumes[0].voxelSize, 0.1);
    EXPECT_EQ(content.volumes[0].channels.at(0).name, "surface");
    // The flat triangles lie up to 0.006 voxels within the sphere.
    // Triangles half a voxel long: OpenVDB keeps one of them for each voxel, not always the nearest.
    EXPECT_LT(worst(content.volumes[0], radius, center), 0.2);
  }
  auto const usual = importMesh(folder / "a.obj");
  EXPECT_NEAR(usual.volumes.at(0).voxelSize, 2 * radius / 256, 1e-12);
}

TEST(MeshTest, RequirementALevelSetBecomesAMeshThatIsSeenFromOutside) {
  TempFolder const folder;
  double3 const center{1, 2, 3};
  writeAll(folder / "a.obj", obj(sphere(2, center, 5)));
  MeshOptions options;
  options.voxelSize = 0.05;
  auto const content = importMesh(folder / "a.obj", options);
  for (double const adaptivity : {0.0, 0.5})
    for (double const iso : {0.0, 0.1}) {
      exportSurface(content, folder / "b.ply", {iso, adaptivity});
      Mesh const back = readMesh(folder / "b.ply");
      double volume = 0;
      for (auto const& t : back.triangles) {
        double3 const a = back.points[t[0]] - center, b = back.points[t[1]] - center,
                      c = back.points[t[2]] - center;
        volume +=
            (a.x * (b.y * c.z - b.z * c.y) + a.y * (b.z * c.x - b.x * c.z) + a.z * (b.x * c.y - b.y * c.x)) /
            6;
      }
      double const r = 2 + iso;
      double const exact = 4.0 / 3 * 3.14159265 * r * r * r;
      // Larger faces cut more off.
      EXPECT_NEAR(volume, exact, (adaptivity > 0 ? 0.04 : 0.01) * exact);
      for (auto const& p : back.points) EXPECT_NEAR(distance(p - center), r, 0.02);
      if (adaptivity > 0) { EXPECT_LT(back.triangles.size(), 60000u); }
    }
  EXPECT_NE(told([&] {
              exportSurface(content, folder / "c.ply", {5, 0});
            }).find("no surface"),
            std::string::npos);
  EXPECT_FALSE(std::filesystem::exists(folder / "c.ply"));
  // A mesh of it is read as one again.
  EXPECT_TRUE(isMeshFile(folder / "b.ply"));
}

TEST(MeshTest, NegativeDamagedFilesAreTold) {
  TempFolder const folder;
  Mesh const mesh = sphere(1, {0, 0, 0}, 1);
  std::string const points = "v 0 0 0\nv 1 0 0\nv 0 1 0\n";
  std::string const binary = stl(mesh);
  std::string huge = binary;
  std::memset(huge.data() + 80, 0xff, 4);
  std::string noNumber = binary;
  float const nan = std::numeric_limits<float>::quiet_NaN();
  std::memcpy(noNumber.data() + 84 + 12, &nan, sizeof nan);
  std::string const head = "ply\nformat ascii 1.0\nelement vertex 3\nproperty float x\nproperty float y\n"
                           "property float z\nelement face ";
  std::string const list = "\nproperty list uchar int vertex_indices\nend_header\n0 0 0\n1 0 0\n0 1 0\n";
  struct Case {
    char const *name, *reason;
    std::string content;
  };
  for (Case const& c : std::vector<Case>{
           {"a.obj", "line 4: a face of the vertex '4'", points + "f 1 2 4\n"},
           {"b.obj", "line 4: a face of the vertex '-4'", points + "f 1 2 -4\n"},
           {"c.obj", "line 4: a face of the vertex '0'", points + "f 0 1 2\n"},
           {"d.obj", "a face of the vertex '99999999999999999999'", points + "f 1 2 99999999999999999999\n"},
           {"e.obj", "fewer than three", points + "f 1 2\n"},
           {"f.obj", "'x' is no coordinate", "v 0 x 0\n"},
           {"g.obj", "no number", "v nan 0 0\nv 1 0 0\nv 0 1 0\nf 1 2 3\n"},
           {"h.obj", "has no face", points},
           {"i.obj", "is empty", ""},
           {"j.obj", "no extent", "v 1 1 1\nf 1 1 1\n"},
           {"a.stl", "announces 4294967295 triangles", huge},
           {"b.stl", "is truncated", binary.substr(0, binary.size() - 1)},
           {"c.stl", "no number", noNumber},
           {"d.stl", "is not an .stl file", "hello"},
           {"e.stl", "no three corners", "solid a\nfacet\nvertex 0 0 0\nvertex 1 0 0\n"},
           {"f.stl", "has no face", "solid a\nendsolid a\n"},
           {"a.ply", "a vertex that is not there", head + "1" + list + "3 0 1 3\n"},
           {"b.ply", "a vertex that is not there", head + "1" + list + "3 0 1 -1\n"},
           {"c.ply", "truncated", head + "99999999999" + list + "3 0 1 2\n"},
           {"d.ply", "fewer than three", head + "1" + list + "2 0 1\n"},
           {"e.ply", "truncated", head + "1" + list + "255 0 1 2\n"},
       }) {
    writeAll(folder / c.name, c.content);
    std::string const reason = told([&] { importVolumes(folder / c.name); });
    EXPECT_NE(reason.find(c.reason), std::string::npos) << c.name << ": " << reason;
    EXPECT_EQ(reason.find('\n'), std::string::npos);
  }
  writeAll(folder / "far.obj", "v 1e30 0 0\nv 1e30 1 0\nv 1e30 0 1\nf 1 2 3\n");
  EXPECT_NE(told([&] { importMesh(folder / "far.obj"); }).find("too far"), std::string::npos);
  writeAll(folder / "fine.obj", obj(mesh));
  MeshOptions options;
  options.voxelSize = 1e-6;
  EXPECT_NE(told([&] { importMesh(folder / "fine.obj", options); }).find("MB of memory"), std::string::npos);
}

TEST(MeshTest, RequirementRealMeshesGiveTheirLevelSets) {
  std::string const data = VLN_TEST_DATA_DIR;
  if (!std::filesystem::exists(data + "/mesh")) GTEST_SKIP() << "no real input files";
  struct Real {
    char const *mesh, *levelSet;
  };
  for (Real const& real :
       {Real{"stanford-bunny-closed.obj", "bunny_ls_128.vdb"}, Real{"spot.obj", "spot_ls_128.vdb"}}) {
    SCOPED_TRACE(real.mesh);
    auto const wanted = importVdb(data + "/vdb/" + real.levelSet);
    MeshOptions options;
    options.voxelSize = wanted.volumes[0].voxelSize;
    auto const found = importMesh(data + "/mesh/" + real.mesh, options);
    auto const &a = wanted.volumes[0].channels[0], &b = found.volumes.at(0).channels.at(0);
    EXPECT_NEAR(double(a.activeVoxels), double(b.activeVoxels), 0.001 * double(a.activeVoxels));
    EXPECT_NEAR(a.minimum, b.minimum, 0.01 * options.voxelSize);
    auto const left = ChannelValues::of(wanted.volumes[0], a.name),
               right = ChannelValues::of(found.volumes[0], b.name);
    for (int z = a.activeBox.min.z; z < a.activeBox.max.z; z += 3)
      for (int y = a.activeBox.min.y; y < a.activeBox.max.y; y += 3)
        for (int x = a.activeBox.min.x; x < a.activeBox.max.x; x += 3)
          ASSERT_NEAR(valueAt(*left, {x, y, z}), valueAt(*right, {x, y, z}), 0.01 * options.voxelSize);
  }
}

} // namespace
} // namespace VLN::Test
