// vln view as people call it: what pages hold, how large they are, and what goes wrong.
#include "GeometryVolume/volume/Volume.h"
#include "Interop/VolumeIo.h"
#include "support/RealVolumes.h"
#include "support/TempFolder.h"
#include "support/TurnedRamp.h"
#include "support/VlnProgram.h"

#include <cmath>
#include <filesystem>
#include <fstream>

namespace VLN::Test {
namespace {

class ViewProgramTest : public testing::Test {
protected:
  std::string made(std::string const& shape, int voxels = 30000) {
    std::string const path = m_folder / (shape + ".vdb");
    EXPECT_EQ(vln({"make", shape, path, "--voxels", std::to_string(voxels)}).code, 0);
    return path;
  }
  std::string file(openvdb::GridPtrVec const& grids, std::string const& name = "grids.vdb") {
    std::string const path = m_folder / name;
    openvdb::io::File out(path);
    out.write(grids);
    out.close();
    return path;
  }

  TempFolder m_folder;
};

#ifndef VLN_WITH_VIEW

// negative: what is missing is said in one line, and no page is left
TEST_F(ViewProgramTest, NegativeBuiltWithoutThePage) {
  std::string const volume = made("cloud"), out = m_folder / "p.html";
  expectFailure(vln({"view", volume, "-o", out}), "this program was built without the viewer's page; "
                                                  "-DVLN_WITH_VIEW=ON builds it in (docs/viewing.md)");
  EXPECT_FALSE(std::filesystem::exists(out));
}

#else

std::string bytesOf(std::string const& path) {
  std::ifstream in(path, std::ios::binary);
  return {std::istreambuf_iterator<char>(in), {}};
}

// The text of a script of the page.
std::string part(std::string const& page, std::string const& id) {
  std::size_t const tag = page.find("id=\"" + id + "\">");
  if (tag == std::string::npos) return "";
  std::size_t const first = page.find('>', tag) + 1;
  return page.substr(first, page.find("</script>", first) - first);
}

class ViewPageTest : public ViewProgramTest {
protected:
  std::string page(std::string const& volume, std::vector<std::string> more = {}) {
    std::string const out = m_folder / "p.html";
    more.insert(more.begin(), {"view", volume, "-o", out});
    RunResult const run = vln(more);
    EXPECT_EQ(run.code, 0) << run.err;
    return bytesOf(out);
  }
  nlohmann::json about(std::string const& volume, std::vector<std::string> more = {}) {
    return nlohmann::json::parse(part(page(volume, std::move(more)), "about"));
  }
};

class ViewRealTest : public ViewPageTest, public testing::WithParamInterface<char const*> {};
INSTANTIATE_TEST_SUITE_P(Files, ViewRealTest, realVolumes(), volumeName);

// requirement: every real file becomes a page that fits, of scripts that ask for nothing
TEST_P(ViewRealTest, RequirementEveryFileHasAPage) {
  std::string const data = VLN_TEST_DATA_DIR;
  if (data.empty()) GTEST_SKIP() << "no real input files";
  std::string const volume = data + "/vdb/" + GetParam();
  std::string const text = page(volume, {"--max-size", "2MB"});
  EXPECT_LT(text.size(), std::size_t(2) << 20);
  auto const json = nlohmann::json::parse(part(text, "about"));
  if (std::string(GetParam()).find("points") != std::string::npos) {
    EXPECT_GT(json["points"]["count"], 1000);
    EXPECT_GT(part(text, "block0").size(), 1000u);
    return;
  }
  std::size_t blocks = 1;
  for (auto const& channel : json["channels"])
    for (auto const& level : channel["levels"]) {
      EXPECT_GT(level["bricks"], 0);
      EXPECT_EQ(level["block"], blocks);
      EXPECT_GT(part(text, "block" + std::to_string(blocks++)).size(), 40u);
    }
  EXPECT_NE(text.find("default-src 'none'"), std::string::npos);
  EXPECT_EQ(text.find("src=\"http"), std::string::npos);
  EXPECT_NE(text.find("Permission is hereby granted"), std::string::npos)
      << "a licence travels with what it is of";
}

// requirement: the size chooses the depth
TEST_F(ViewPageTest, RequirementSizeChoosesTheDepth) {
  std::string const volume = made("torus", 400000);
  int deepest = 29;
  std::size_t last = ~std::size_t(0);
  for (std::string const size : {"20MB", "300KB"}) {
    std::string const text = page(volume, {"--max-size", size});
    auto const json = nlohmann::json::parse(part(text, "about"));
    int const depth = json["channels"][0]["levels"].back()["depth"];
    EXPECT_LT(depth, deepest) << size;
    EXPECT_LT(text.size(), last);
    deepest = depth, last = text.size();
    if (size != "20MB") { EXPECT_LE(text.size(), std::stoul(size) * 1024); }
  }
}

// A sphere of coloured points far from the origin.
std::string dots(std::string const& path, int count) {
  std::ofstream out(path);
  out << "ply\nformat ascii 1.0\nelement vertex " << count
      << "\nproperty double x\nproperty double y\nproperty double z\nproperty uchar red\nproperty uchar "
         "green\n"
         "property uchar blue\nend_header\n";
  out.precision(12);
  for (int n = 0; n < count; ++n) {
    double const z = 1 - 2 * (n + 0.5) / count, r = std::sqrt(1 - z * z), a = 2.399963 * n;
    out << 600000 + 5 * r * std::cos(a) << ' ' << 800000 + 5 * r * std::sin(a) << ' ' << 10 * z << ' '
        << 40 + n * 200 / count << " 90 " << 240 - n * 200 / count << '\n';
  }
  return path;
}

// requirement: of points as many as fit, and larger ones
TEST_F(ViewPageTest, RequirementSizeChoosesThePoints) {
  std::string const file = dots(m_folder / "dots.ply", 200000);
  auto const all = about(file)["points"];
  EXPECT_EQ(all["count"], 200000);
  std::string const text = page(file, {"--max-size", "256KB"});
  EXPECT_LE(text.size(), std::size_t(256) << 10);
  auto const few = nlohmann::json::parse(part(text, "about"))["points"];
  EXPECT_GT(few["count"], 5000);
  EXPECT_LT(few["count"], 100000);
  EXPECT_GT(few["radius"], all["radius"]);
  expectFailure(vln({"view", file, "--max-size", "1KB", "-o", m_folder / "q.html"}),
                "--max-size: Value 1024 not in range 262144 to 1099511627776 (vln --help tells more)");
}

// requirement
TEST_F(ViewPageTest, RequirementDepthIsKept) {
  std::string const volume = made("torus", 400000);
  EXPECT_EQ(about(volume, {"--depth", "26"})["channels"][0]["levels"].back()["depth"], 26);
  RunResult const run =
      vln({"view", volume, "--depth", "28", "--max-size", "256KB", "-o", m_folder / "q.html"});
  expectFailure(run, volume + ": its depth 28 does not fit into the size");
  EXPECT_FALSE(std::filesystem::exists(m_folder / "q.html"));
}

// requirement: the page begins with what render would draw
TEST_F(ViewPageTest, RequirementBeginsWithRendersPicture) {
  std::string const volume = made("cloud"), parameters = m_folder / "p.json";
  std::vector<std::string> const options = {"--cmap",  "magma", "--opacity", "sigmoid", "--camera-direction",
                                            "1,-1,0.5"};
  auto const json = about(volume, options);
  std::vector<std::string> render{"render", volume, "-o", m_folder / "p.png", "--parameters", parameters};
  render.insert(render.end(), options.begin(), options.end());
  ASSERT_EQ(vln(render).code, 0);
  auto const picture = nlohmann::json::parse(bytesOf(parameters));
  EXPECT_EQ(json["camera"]["position"], picture["camera"]["position"]);
  EXPECT_EQ(json["camera"]["focalPoint"], picture["camera"]["focal_point"]);
  auto const& channel = json["channels"][0];
  EXPECT_EQ(channel["mode"], picture["mode"]);
  EXPECT_EQ(channel["range"], picture["clim"]);
  EXPECT_EQ(channel["opacity"], picture["opacity"]);
  EXPECT_EQ(channel["unit"], picture["opacity_unit"]);
}

// requirement: where voxels lie in the world
TEST_F(ViewPageTest, RequirementTransformsAreKept) {
  auto const grid = turnedRamp();
  auto const json = about(file({grid}))["channels"][0];
  auto const matrix = grid->transform().baseMap()->getAffineMap()->getMat4();
  for (int row = 0; row < 3; ++row)
    for (int column = 0; column < 3; ++column)
      EXPECT_NEAR(json["rows"][row][column], matrix[column][row], 1e-12);
  // The box of the voxels, one more on each side, from the local origin.
  openvdb::Vec3d const first = grid->transform().indexToWorld(openvdb::Vec3d(-9, -1, 7));
  for (int a = 0; a < 3; ++a) {
    double world = json["shift"][a];
    for (int b = 0; b < 3; ++b) world += double(json["rows"][a][b]) * double(json["boxLow"][b]);
    EXPECT_NEAR(world, first[a], 1e-5);
  }
}

// requirement
TEST_F(ViewPageTest, RequirementSeveralChannels) {
  openvdb::initialize();
  auto const sphere = [](char const* name, auto value) {
    auto grid = openvdb::Grid<typename openvdb::tree::Tree4<decltype(value), 5, 4, 3>::Type>::create(
        decltype(value)(0));
    grid->setName(name);
    for (int n = 0; n < 2000; ++n)
      grid->tree().setValueOn(openvdb::Coord(n % 20, n / 20 % 10, n / 200), value);
    return grid;
  };
  std::string const volume = file(
      {sphere("whole", std::int32_t(7)), sphere("fine", 0.25f), sphere("speed", openvdb::Vec3f(3, 4, 0))});
  auto const json = about(volume, {"--channel", "speed", "--channel", "whole", "--channel", "fine"});
  ASSERT_EQ(json["channels"].size(), 3u);
  EXPECT_EQ(json["channels"][0]["name"], "speed");
  EXPECT_EQ(json["channels"][0]["high"], 5);
  EXPECT_EQ(json["channels"][1]["high"], 7);
  EXPECT_EQ(json["channels"][2]["high"], 0.25);
  EXPECT_EQ(about(volume, {"--channel", "speed", "--component", "y"})["channels"][0]["high"], 4);
}

// requirement: .nvtt files too
TEST_F(ViewPageTest, RequirementFlatBuffers) {
  std::string const volume = made("cloud"), flat = m_folder / "cloud.nvtt";
  ASSERT_EQ(vln({"flatten", volume, flat}).code, 0);
  auto const one = about(volume)["channels"][0], other = about(flat)["channels"][0];
  EXPECT_EQ(one["levels"].back()["bricks"], other["levels"].back()["bricks"]);
  EXPECT_EQ(one["range"], other["range"]);
}

// regression: names may be anything, and end no script
TEST_F(ViewPageTest, RegressionNamesEndNoScript) {
  std::string const name = "</script><script>alert(1)</script><!--";
  TileTree3D::Volume volume;
  auto field = volume.addField<float>(name, 0);
  for (int i = 0; i < 8; ++i) field.set(i, i, 0, 1);
  std::string const path = m_folder / "a<b>&c.vdb";
  Interop::save(volume, path);
  std::string const text = page(path);
  auto const json = nlohmann::json::parse(part(text, "about"));
  EXPECT_EQ(json["channels"][0]["name"], name);
  EXPECT_EQ(text.find("alert(1)</script>"), std::string::npos);
  EXPECT_NE(text.find("<title>a&lt;b&gt;&amp;c.vdb</title>"), std::string::npos);
}

// boundary: far from the origin, and sparse beyond what any index of bricks could hold densely
TEST_F(ViewPageTest, BoundaryHugeCoordinates) {
  openvdb::initialize();
  auto grid = openvdb::FloatGrid::create(0.0f);
  grid->setName("density");
  for (int n = 0; n < 64; ++n) {
    grid->tree().setValueOn(openvdb::Coord(100000000 + n, -90000000, 80000000 + n), 1.0f);
    grid->tree().setValueOn(openvdb::Coord(100000000 + n + 200000, -90000000 + 100000, 80000000), 1.0f);
  }
  auto const levels = about(file({grid}))["channels"][0]["levels"];
  EXPECT_EQ(levels.back()["depth"], 28);
  EXPECT_LT(levels.back()["bricks"], 100);
}

// boundary: active tiles stay a few bricks
TEST_F(ViewPageTest, BoundaryLargeTilesAreFewBricks) {
  openvdb::initialize();
  auto grid = openvdb::FloatGrid::create(0.0f);
  grid->setName("density");
  grid->fill(openvdb::CoordBBox(openvdb::Coord(0), openvdb::Coord(255)), 0.5f);
  for (int n = 0; n < 20; ++n) grid->tree().setValueOn(openvdb::Coord(200 + n, 200, 200), 1.0f);
  std::string const text = page(file({grid}));
  auto const json = nlohmann::json::parse(part(text, "about"))["channels"][0];
  EXPECT_EQ(json["levels"].back()["depth"], 28);
  EXPECT_LT(json["levels"].back()["bricks"], 16384); // of 32768
  EXPECT_LT(text.size(), 500000u);
}

// negative
TEST_F(ViewPageTest, NegativeOneLineEach) {
  openvdb::initialize();
  auto const empty = openvdb::FloatGrid::create(1.0f);
  empty->setName("empty");
  std::string const nothing = file({empty}, "empty.vdb"), cloud = made("cloud"), out = m_folder / "q.html";
  expectFailure(vln({"view", nothing, "--channel", "empty", "-o", out}),
                nothing + ": channel 'empty' has no active voxel");
  expectFailure(vln({"view", cloud, "-o", m_folder / "q.png"}),
                (m_folder / "q.png") + ": pages are written as .html");
  for (std::vector<std::string> const& options : {std::vector<std::string>{"--max-size", "12"},
                                                  {"--max-size", "x"},
                                                  {"--depth", "29"},
                                                  {"--cmap", "none"},
                                                  {"--channel", "nothing"},
                                                  {"--opacity", "steep"},
                                                  {"--clim", "1,0"},
                                                  {"--iso", "9"},
                                                  {"--camera-view-up", "0,0,0"}}) {
    std::vector<std::string> all{"view", cloud, "-o", out};
    all.insert(all.end(), options.begin(), options.end());
    RunResult const run = vln(all);
    EXPECT_NE(run.code, 0) << options[0];
    EXPECT_EQ(run.out, "");
    EXPECT_FALSE(run.err.empty());
    EXPECT_FALSE(std::filesystem::exists(out)) << options[0];
  }
  EXPECT_NE(vln({"view", m_folder / "none.vdb", "-o", out}).code, 0);
}

// requirement: as other outputs, whole or not at all
TEST_F(ViewPageTest, RequirementOutputIsWholeOrNotThere) {
  std::string const volume = made("cloud"), out = m_folder / "p.html";
  std::ofstream(out) << "before";
  EXPECT_NE(vln({"view", volume, "--channel", "none", "-o", out}).code, 0);
  EXPECT_EQ(bytesOf(out), "before");
  RunResult const piped = vln({"view", volume, "-o", "/dev/stdout"});
  EXPECT_EQ(piped.code, 0);
  EXPECT_EQ(piped.out.substr(0, 15), "<!doctype html>");
  EXPECT_EQ(piped.out.substr(piped.out.size() - 8), "</html>\n");
}

// requirement: what the page draws in a browser, beside the pictures of render, and what its controls do
TEST_F(ViewProgramTest, RequirementPagesInABrowser) {
  made("cloud"), made("torus", 60000);
  // Turned, of voxels that are no cubes, far from the origin; with a coarse inside.
  auto const turned = turnedRamp();
  turned->setName("ramp");
  file({turned}, "turned.vdb");
  auto const egg = openvdb::FloatGrid::create(3.0f);
  egg->setName("surface");
  egg->setGridClass(openvdb::GRID_LEVEL_SET);
  auto const transform = turned->transform().copy();
  transform->preTranslate(openvdb::Vec3d(-40000, 30000, 20000));
  egg->setTransform(transform);
  openvdb::Coord const middle(40000, -30000, -20000);
  for (auto it = openvdb::CoordBBox(openvdb::Coord(-18), openvdb::Coord(18)).begin(); it; ++it) {
    double const d = (*it).asVec3d().length() - 14;
    if (std::abs(d) < 3)
      egg->tree().setValueOn(*it + middle, static_cast<float>(d));
    else if (d < 0)
      egg->tree().setValueOff(*it + middle, -3.0f);
  }
  file({egg}, "egg.vdb");
  auto const steps = openvdb::FloatGrid::create(0.0f); // of tiles 8 and 128 wide
  steps->setName("density");
  steps->fill(openvdb::CoordBBox(openvdb::Coord(0), openvdb::Coord(127, 127, 127)), 0.3f);
  steps->fill(openvdb::CoordBBox(openvdb::Coord(128, 0, 0), openvdb::Coord(159, 63, 63)), 0.6f);
  for (int n = 0; n < 12; ++n)
    steps->fill(openvdb::CoordBBox(openvdb::Coord(160 + n, 10, 10), openvdb::Coord(160 + n, 20 + n, 20 + n)),
                1.0f);
  auto const other = steps->deepCopy();
  other->setName("other");
  file({steps, other}, "tiles.vdb");
  // Zeros round it, which no surface crosses.
  auto const halo = egg->deepCopy();
  halo->tree().clear();
  for (auto it = openvdb::CoordBBox(openvdb::Coord(-18), openvdb::Coord(18)).begin(); it; ++it) {
    double const d = (*it).asVec3d().length() - 11;
    halo->tree().setValueOn(
        *it, static_cast<float>(d < 0 ? std::max(d, -2.7) : std::max(0.0, std::min(d - 4, 3.0))));
  }
  file({halo}, "zeros.vdb");
  dots(m_folder / "dots.ply", 3000);
  RunResult const run = runProgram({VLN_NODE, VLN_VIEW_TEST, VLN_PROGRAM, VLN_VIEW_MODULES, m_folder / ""});
  std::cout << run.out;
  EXPECT_EQ(run.code, 0) << run.err;
}

#endif

} // namespace
} // namespace VLN::Test
