// The commands on points, run as processes.
#include "Interop/Ply.h"
#include "Interop/VdbTypesImpl.h"
#include "support/VlnProgram.h"

#include <algorithm>
#include <cmath>
#include <fstream>

namespace {

using namespace VLN::Test;
using Json = nlohmann::ordered_json;

class PointsProgramTest : public testing::Test {
protected:
  /// A spiral of 5000 coloured points.
  std::string spiral() {
    VLN::Interop::PointSet set;
    set.attributes = {VLN::Interop::makeAttribute<float>("age")};
    for (int n = 0; n < 5000; ++n) {
      float const a = 0.01f * static_cast<float>(n);
      set.positions.push_back({a * std::cos(a), a * std::sin(a), 0.3f * a});
      set.attributes[0].append(a);
    }
    std::string const path = m_folder / "spiral.ply";
    VLN::Interop::writePly(path, set);
    return path;
  }
  std::size_t count(std::string const& path, std::string const& start) const {
    std::ifstream in(path);
    std::size_t n = 0;
    for (std::string line; std::getline(in, line);) n += line.compare(0, start.size(), start) == 0;
    return n;
  }
  TempFolder m_folder;
};

TEST_F(PointsProgramTest, PointsGoFromFormatToFormat) {
  std::string const ply = spiral(), vdb = m_folder / "s.vdb", back = m_folder / "b.ply",
                    obj = m_folder / "s.obj";
  for (auto const& [from, to] : {std::pair(ply, vdb), std::pair(vdb, back), std::pair(back, obj)}) {
    RunResult const run = vln({"points", from, "-o", to});
    EXPECT_EQ(run.code, 0) << run.err;
    EXPECT_EQ(run.err, "");
    EXPECT_EQ(run.out.rfind("5000 points in ", 0), 0u) << run.out;
  }
  EXPECT_EQ(count(obj, "v "), 40000u);
  EXPECT_EQ(count(obj, "f "), 30000u);
  auto const set = VLN::Interop::readPly(back);
  ASSERT_EQ(set.size(), 5000u);
  for (std::size_t n = 0; n < set.size(); ++n) {
    double const a = double(set.attributes.at(0).value<float>(n));
    ASSERT_NEAR(set.world(n).x, a * std::cos(a), 1e-4);
    ASSERT_NEAR(set.world(n).z, 0.3 * a, 1e-4);
  }
}

TEST_F(PointsProgramTest, InfoTellsOfPoints) {
  RunResult const run = vln({"info", spiral(), "--json"});
  ASSERT_EQ(run.code, 0) << run.err;
  Json const j = Json::parse(run.out);
  ASSERT_EQ(j["objects"].size(), 1u);
  Json const& channels = j["objects"][0]["channels"];
  ASSERT_EQ(channels.size(), 2u);
  EXPECT_EQ(channels[0]["name"], "positions");
  EXPECT_EQ(channels[0]["type"], "float3");
  EXPECT_EQ(channels[0]["elements"], 5000);
  EXPECT_EQ(channels[1]["name"], "age");
  EXPECT_EQ(channels[1]["min"], 0.0);
  EXPECT_NEAR(channels[1]["max"].get<double>(), 49.99, 1e-4);
  EXPECT_NEAR(j["objects"][0]["world_bounds"][1][2].get<double>(), 0.3 * 49.99, 1e-4);
  EXPECT_EQ(vln({"info", m_folder / "spiral.ply"}).code, 0);
}

TEST_F(PointsProgramTest, AdvectingConservesThePoints) {
  std::string const moved = m_folder / "moved.ply";
  RunResult const run =
      vln({"advect", spiral(), "--velocity", "0.5", "-0.25", "2", "--steps", "100", "--json", "-o", moved});
  ASSERT_EQ(run.code, 0) << run.err;
  EXPECT_EQ(run.err, "") << "no bar in a pipe";
  Json const j = Json::parse(run.out);
  std::vector<std::string> keys;
  for (auto const& item : j.items()) keys.push_back(item.key());
  EXPECT_EQ(keys, (std::vector<std::string>{"points_before", "points_after", "dropped", "steps", "seconds",
                                            "tiles_before", "tiles_after"}));
  EXPECT_EQ(j["points_before"], 5000);
  EXPECT_EQ(j["points_after"], 5000);
  EXPECT_EQ(j["dropped"], 0);
  EXPECT_EQ(j["steps"], 100);
  auto const set = VLN::Interop::readPly(moved);
  ASSERT_EQ(set.size(), 5000u);
  for (std::size_t n = 0; n < set.size(); ++n) {
    double const a = double(set.attributes.at(0).value<float>(n));
    ASSERT_NEAR(set.world(n).x, a * std::cos(a) + 50, 0.01);
    ASSERT_NEAR(set.world(n).z, 0.3 * a + 200, 0.01);
  }
}

TEST_F(PointsProgramTest, TilesBecomeBoxesWithTheirMaterials) {
  std::string const obj = m_folder / "tiles.obj";
  RunResult const run = vln({"tiles", spiral(), "--depth", "28", "-o", obj});
  ASSERT_EQ(run.code, 0) << run.err;
  EXPECT_GT(count(obj, "usemtl"), 10u);
  EXPECT_EQ(count(obj, "v "), 8 * count(obj, "usemtl"));
  EXPECT_EQ(count(m_folder / "tile_tree.mtl", "newmtl"), 3u);
  ASSERT_EQ(vln({"make", "torus", m_folder / "t.vdb", "--voxels", "20000"}).code, 0);
  EXPECT_EQ(vln({"tiles", m_folder / "t.vdb", "--depth", "28", "-o", obj}).code, 0);
  EXPECT_GT(count(obj, "usemtl"), 100u);
}

// regression: positions went through floats, which are half a metre apart out there
TEST_F(PointsProgramTest, RegressionSurveyCoordinatesKeepTheirMillimetres) {
  VLN::Interop::PointSet set;
  set.origin = {4500000, 500000, 120};
  set.doublePositions = true;
  for (int n = 0; n < 3000; ++n)
    set.positions.push_back({0.013f * float(n % 101), 0.017f * float(n % 97), 0.001f * float(n)});
  set.attributes = {VLN::Interop::makeAttribute<float>("id")};
  for (int n = 0; n < 3000; ++n) set.attributes[0].append(float(n));
  std::string const ply = m_folder / "survey.ply", vdb = m_folder / "survey.vdb",
                    back = m_folder / "back.ply", obj = m_folder / "survey.obj";
  VLN::Interop::writePly(ply, set);
  for (auto const& [from, to] : {std::pair(ply, vdb), std::pair(vdb, back), std::pair(vdb, obj)}) {
    RunResult const run = vln({"points", from, "-o", to, "--size", "0.001"});
    ASSERT_EQ(run.code, 0) << run.err;
  }
  auto const read = VLN::Interop::readPly(back);
  ASSERT_EQ(read.size(), set.size());
  for (std::size_t n = 0; n < read.size(); ++n) {
    auto const was = set.world(static_cast<std::size_t>(read.attributes.at(0).value<float>(n)));
    for (int a = 0; a < 3; ++a) ASSERT_NEAR(read.world(n)[a], was[a], 1e-5);
  }
  // The boxes stand where the points are, each two millimetres wide.
  std::ifstream in(obj);
  std::string word;
  double x = 0, y = 0, z = 0, lowest = 1e300, highest = -1e300;
  while (in >> word)
    if (word == "v" && in >> x >> y >> z) lowest = std::min(lowest, x), highest = std::max(highest, x);
  EXPECT_NEAR(lowest, 4500000 - 0.001, 2e-5);
  EXPECT_NEAR(highest, 4500000 + 0.013 * 100 + 0.001, 2e-5);
}

// regression: tiles of the first object only were drawn, without its transform, whatever --grid said
TEST_F(PointsProgramTest, RegressionTilesStandInTheWorld) {
  openvdb::initialize();
  auto const box = [](char const* name, double size, openvdb::Vec3d const& at) {
    auto grid = openvdb::FloatGrid::create();
    grid->setName(name);
    grid->setTransform(openvdb::math::Transform::createLinearTransform(size));
    grid->transform().postRotate(0.5, openvdb::math::Z_AXIS);
    grid->transform().postTranslate(at);
    grid->tree().setValueOn({1, 1, 1}, 1.0f);
    return grid;
  };
  openvdb::GridPtrVec const grids{box("near", 0.5, {0, 0, 0}), box("far", 2, {1000, 0, 0})};
  std::string const vdb = m_folder / "two.vdb", obj = m_folder / "two.obj";
  openvdb::io::File(vdb).write(grids);
  auto const corners = [&](std::vector<std::string> const& more) {
    std::vector<std::string> arguments{"tiles", vdb, "--depth", "28", "-o", obj};
    arguments.insert(arguments.end(), more.begin(), more.end());
    RunResult const run = vln(arguments);
    EXPECT_EQ(run.code, 0) << run.err;
    std::vector<openvdb::Vec3d> found;
    std::ifstream in(obj);
    for (std::string word; in >> word;) {
      openvdb::Vec3d p;
      if (word == "v" && in >> p.x() >> p.y() >> p.z()) found.push_back(p);
    }
    return found;
  };
  EXPECT_EQ(corners({}).size(), 16u);
  auto const far = corners({"--grid", "far"});
  ASSERT_EQ(far.size(), 8u);
  for (int n = 0; n < 8; ++n) {
    auto const expected = grids[1]->indexToWorld(openvdb::Vec3d(n & 1 ? 4 : 0, n & 2 ? 4 : 0, n & 4 ? 4 : 0));
    EXPECT_LT((far[std::size_t(n)] - expected).length(), 1e-6);
  }
  expectFailure(vln({"tiles", vdb, "--depth", "28", "--grid", "none", "-o", obj}),
                vdb + ": has no grid 'none'");
}

TEST_F(PointsProgramTest, FailuresAreOneLineAndLeaveNoFile) {
  std::string const out = m_folder / "out.ply", bad = m_folder / "bad.ply";
  expectFailure(vln({"points", m_folder / "no.ply", "-o", out}),
                m_folder / "no.ply: No such file or directory");
  std::ofstream(bad)
      << "ply\nformat ascii 1.0\nelement vertex 1000000000000\nproperty float x\nproperty float y\n"
         "property float z\nend_header\n1 2 3\n";
  std::string const missing = ": is truncated: data that its header announces is missing";
  expectFailure(vln({"points", bad, "-o", out}), bad + missing);
  expectFailure(vln({"info", bad}), bad + missing);
  expectFailure(vln({"advect", bad, "--velocity", "1", "0", "0", "-o", out}), bad + missing);
  expectFailure(vln({"points", spiral(), "-o", m_folder / "out.xyz"}),
                m_folder / "out.xyz: points are written as .obj, .ply or .vdb");
  ASSERT_EQ(vln({"make", "torus", m_folder / "t.vdb", "--voxels", "20000"}).code, 0);
  expectFailure(vln({"points", m_folder / "t.vdb", "-o", out}), m_folder / "t.vdb: has no points grid");
  auto names = m_folder.names();
  std::sort(names.begin(), names.end());
  EXPECT_EQ(names, (std::vector<std::string>{"bad.ply", "spiral.ply", "t.vdb"}));
}

} // namespace
