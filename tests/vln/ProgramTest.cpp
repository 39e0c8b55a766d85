// The program as its users meet it: run as a process, judged by what it says, writes and returns.
#include "support/PngReader.h"
#include "support/RealVolumes.h"
#include "support/TurnedRamp.h"
#include "support/VlnProgram.h"

#include <algorithm>
#include <array>
#include <set>
#include <sstream>

namespace {

using namespace VLN::Test;
using Json = nlohmann::ordered_json;

int distinctColors(VLN::Interop::Image const& image) {
  std::set<std::array<int, 3>> colors;
  for (int y = 0; y < image.height(); ++y)
    for (int x = 0; x < image.width(); ++x) colors.insert({image(x, y).r, image(x, y).g, image(x, y).b});
  return int(colors.size());
}

class ProgramTest : public testing::Test {
protected:
  // A small torus, made by the program.
  std::string torus(std::string const& name = "torus.vdb") {
    std::string const path = m_folder / name;
    RunResult const run = vln({"make", "torus", path, "--voxels", "20000"});
    EXPECT_EQ(run.code, 0) << run.err;
    return path;
  }

  TempFolder m_folder;
};

// requirement
TEST_F(ProgramTest, TellsItsVersionAndItsUse) {
  RunResult const version = vln({"--version"});
  EXPECT_EQ(version.code, 0);
  EXPECT_EQ(version.out.rfind("vln ", 0), 0u) << version.out;
  EXPECT_EQ(std::count(version.out.begin(), version.out.end(), '\n'), 1);
  RunResult const help = vln({"--help"});
  EXPECT_EQ(help.code, 0);
  for (char const* command : {"info", "slice", "probe", "make", "churn"}) {
    EXPECT_NE(help.out.find("\n  vln " + std::string(command) + " "), std::string::npos) << help.out;
    RunResult const one = vln({command, "--help"});
    EXPECT_EQ(one.code, 0);
    EXPECT_NE(one.out.find("Example:\n  vln " + std::string(command) + " "), std::string::npos) << one.out;
  }
}

// requirement: the keys of the report are fixed
TEST_F(ProgramTest, InfoAsJsonHasStableKeys) {
  std::string const path = torus();
  RunResult const run = vln({"info", path, "--json"});
  ASSERT_EQ(run.code, 0) << run.err;
  EXPECT_EQ(run.err, "");
  Json const j = Json::parse(run.out);
  EXPECT_EQ(keysOf(j), (std::vector<std::string>{"file", "objects", "skipped", "metadata"}));
  EXPECT_EQ(j["file"], path);
  EXPECT_EQ(j["skipped"], Json::array());
  ASSERT_EQ(j["objects"].size(), 1u);
  Json const& object = j["objects"][0];
  EXPECT_EQ(keysOf(object),
            (std::vector<std::string>{"voxel_size", "tiles", "channels", "memory", "world_bounds",
                                      "active_box", "active_world_bounds", "matrix"}));
  ASSERT_FALSE(object["tiles"].empty());
  std::int64_t tiles = 0;
  for (Json const& depth : object["tiles"]) {
    EXPECT_EQ(keysOf(depth), (std::vector<std::string>{"depth", "count"}));
    EXPECT_GT(depth["count"], 0);
    tiles += depth["count"].get<std::int64_t>();
  }
  ASSERT_EQ(object["channels"].size(), 1u);
  Json const& channel = object["channels"][0];
  EXPECT_EQ(keysOf(channel),
            (std::vector<std::string>{"name", "type", "core", "halo", "elements", "active", "min", "max",
                                      "class", "background", "half", "compression", "metadata"}));
  EXPECT_EQ(channel["name"], "surface");
  EXPECT_EQ(channel["type"], "float");
  EXPECT_EQ(channel["core"], 4);
  EXPECT_EQ(channel["halo"], 0);
  EXPECT_EQ(channel["elements"], 64 * tiles);
  EXPECT_NEAR(channel["active"].get<double>(), 20000, 200);
  EXPECT_LT(channel["min"], 0);
  EXPECT_GT(channel["max"], 0);
  EXPECT_EQ(keysOf(object["memory"]), (std::vector<std::string>{"used", "allocated"}));
  EXPECT_GT(object["memory"]["used"], 4 * 64 * tiles);
  EXPECT_GE(object["memory"]["allocated"], object["memory"]["used"]);
  double const size = object["voxel_size"];
  ASSERT_EQ(object["world_bounds"].size(), 2u);
  for (std::size_t a = 0; a < 3; ++a) {
    // The torus is 1.4 wide from its middle, 0.4 along z; its band adds 3 voxels and the tiles at most 4.
    double const far = (a == 2 ? 0.4 : 1.4) + 3 * size;
    EXPECT_NEAR(object["world_bounds"][0][a], -far, 4.01 * size);
    EXPECT_NEAR(object["world_bounds"][1][a], far, 4.01 * size);
  }
}

// requirement
TEST_F(ProgramTest, InfoPrintsTables) {
  std::string const path = torus();
  RunResult const run = vln({"info", path});
  ASSERT_EQ(run.code, 0) << run.err;
  EXPECT_EQ(run.err, "");
  EXPECT_EQ(run.out.rfind(path + "\n", 0), 0u);
  for (char const* part :
       {"voxel size", "world box", "depth", "surface", "float", "active voxels", "MB used", "MB allocated",
        "bytes for each active voxel", "coarse values equal those of their children: surface"})
    EXPECT_NE(run.out.find(part), std::string::npos) << part << " in\n" << run.out;
  EXPECT_EQ(run.out.find('\r'), std::string::npos);
}

// requirement: through the tree and back, and nothing left where it cannot be
TEST_F(ProgramTest, ConvertWritesTheGridsAgain) {
  std::string const path = torus(), copy = m_folder / "copy.vdb";
  RunResult const run = vln({"convert", path, copy});
  ASSERT_EQ(run.code, 0) << run.err;
  EXPECT_EQ(run.out, copy + ": 1 grid written\n");
  RunResult const before = vln({"info", path, "--json"}), after = vln({"info", copy, "--json"});
  Json a = Json::parse(before.out), b = Json::parse(after.out);
  a.erase("file"), b.erase("file");
  EXPECT_EQ(a, b);
  std::string const nowhere = m_folder / "none/copy.vdb";
  expectFailure(vln({"convert", path, nowhere}), nowhere + ": cannot be written: No such file or directory");
}

// boundary: grids that do not come in, an empty one, and a transform that is more than a scale
TEST_F(ProgramTest, InfoNamesWhatIsLeftOut) {
  openvdb::initialize();
  using Odd = openvdb::Grid<openvdb::tree::Tree4<float, 3, 2, 2>::Type>;
  Odd::registerGrid();
  auto odd = Odd::create();
  odd->setName("odd");
  auto empty = openvdb::FloatGrid::create(2.0f);
  empty->setName("empty");
  empty->transform().postTranslate(openvdb::Vec3d(1, 2, 3));
  std::string const path = m_folder / "odd.vdb";
  openvdb::io::File(path).write(openvdb::GridPtrVec{odd, empty});
  Odd::unregisterGrid();

  RunResult const text = vln({"info", path});
  EXPECT_EQ(text.code, 0);
  EXPECT_NE(text.out.find("odd: grids of type Tree_float_3_2_2 are not read"), std::string::npos) << text.out;
  EXPECT_NE(text.out.find("transform: a uniform scale with a translation"), std::string::npos);
  EXPECT_NE(text.out.find("no voxel is active"), std::string::npos);

  RunResult const json = vln({"info", path, "--json"});
  Json const j = Json::parse(json.out);
  ASSERT_EQ(j["skipped"].size(), 1u);
  EXPECT_EQ(keysOf(j["skipped"][0]), (std::vector<std::string>{"grid", "reason"}));
  EXPECT_EQ(j["skipped"][0]["grid"], "odd");
  EXPECT_EQ(j["objects"][0]["world_bounds"], nullptr);
  EXPECT_EQ(j["objects"][0]["channels"][0]["active"], 0);
  EXPECT_EQ(j["objects"][0]["channels"][0]["min"], nullptr);
}

// requirement: a picture that shows something
TEST_F(ProgramTest, SliceWritesAPicture) {
  std::string const path = torus(), picture = m_folder / "slice.png";
  for (char const* axis : {"x", "y", "z"}) {
    RunResult const run =
        vln({"slice", path, "--channel", "surface", "--axis", axis, "--size", "200", "-o", picture});
    ASSERT_EQ(run.code, 0) << run.err;
    EXPECT_EQ(run.err, "");
    VLN::Interop::Image const image = readPng(picture);
    EXPECT_GE(std::max(image.width(), image.height()), 200);
    EXPECT_GT(distinctColors(image), 60) << axis;
  }
  RunResult const run =
      vln({"slice", path, "--channel", "surface", "--axis", "z", "--at", "0.2", "-o", picture});
  EXPECT_EQ(run.code, 0) << run.err;
  EXPECT_NE(run.out.find("surface at z = 0.2"), std::string::npos) << run.out;
}

// requirement: nearest samples, blends and gradients are three pictures
TEST_F(ProgramTest, SliceDrawsInThreeWays) {
  std::string const path = torus();
  std::vector<std::string> pictures;
  for (char const* way : {"--size", "--nearest", "--gradient"}) {
    std::string const picture = m_folder / (std::string(way) + ".png");
    std::vector<std::string> arguments{"slice", path, "--channel", "surface", "--axis",
                                       "z",     "-o", picture,     "--size",  "300"};
    if (std::string(way) != "--size") arguments.push_back(way);
    RunResult const run = vln(arguments);
    ASSERT_EQ(run.code, 0) << run.err;
    EXPECT_EQ(run.out.rfind("gradient of surface", 0) == 0, std::string(way) == "--gradient") << run.out;
    pictures.push_back(readAll(picture));
  }
  EXPECT_NE(pictures[0], pictures[1]);
  EXPECT_NE(pictures[0], pictures[2]);
}

// requirement: CSV with a fixed header, from the command line and from a file
TEST_F(ProgramTest, ProbePrintsValuesAndGradients) {
  std::string const path = torus(), points = m_folder / "points.csv";
  // On the middle of the tube, whose radius is 0.4 and which runs at 1 from the axis.
  RunResult const run =
      vln({"probe", path, "--channel", "surface", "1.4", "0", "0", "-1.4", "0", "0", "50", "0", "0"});
  ASSERT_EQ(run.code, 0) << run.err;
  EXPECT_EQ(run.err, "");
  std::vector<std::vector<double>> rows;
  std::istringstream lines(run.out);
  std::string line;
  ASSERT_TRUE(std::getline(lines, line));
  EXPECT_EQ(line, "x,y,z,value,gx,gy,gz");
  while (std::getline(lines, line)) {
    rows.emplace_back();
    std::istringstream cells(line);
    for (std::string cell; std::getline(cells, cell, ',');) rows.back().push_back(std::stod(cell));
    EXPECT_EQ(rows.back().size(), 7u);
  }
  ASSERT_EQ(rows.size(), 3u);
  EXPECT_NEAR(rows[0][0], 1.4, 1e-6);
  EXPECT_NEAR(rows[0][3], 0, 0.02);
  EXPECT_NEAR(rows[0][4], 1, 0.05);
  EXPECT_NEAR(rows[1][4], -1, 0.05);
  EXPECT_NEAR(rows[0][5], 0, 0.1);
  EXPECT_EQ(rows[2][4], 0); // far away: the background, and no gradient
  EXPECT_GT(rows[2][3], 0);

  writeAll(points, "1.4,0,0\n-1.4, 0 ,0\r\n\n50,0,0");
  RunResult const file = vln({"probe", path, "--channel", "surface", "--points", points});
  EXPECT_EQ(file.code, 0) << file.err;
  EXPECT_EQ(file.out, run.out);
  writeAll(points, "");
  EXPECT_EQ(vln({"probe", path, "--channel", "surface", "--points", points}).out, "x,y,z,value,gx,gy,gz\n");
}

// requirement: positions and gradients go through the whole transform, here a shift, three voxel sizes and a
// turn
TEST_F(ProgramTest, ProbeAndSliceFollowTheWholeTransform) {
  auto const grid = turnedRamp();
  auto const turned = grid->transformPtr();
  std::string const path = m_folder / "turned.vdb", points = m_folder / "turned.csv";
  openvdb::io::File(path).write(openvdb::GridPtrVec{grid});

  std::string text;
  std::vector<openvdb::Vec3d> places;
  for (openvdb::Vec3d const index :
       {openvdb::Vec3d(1, 2, 9), openvdb::Vec3d(-6.25, 3.5, 20.125), openvdb::Vec3d(12.75, 13.1, 14.9)}) {
    places.push_back(turned->indexToWorld(index));
    std::ostringstream line;
    line.precision(17);
    line << places.back().x() << ',' << places.back().y() << ',' << places.back().z() << '\n';
    text += line.str();
  }
  writeAll(points, text);
  RunResult const run = vln({"probe", path, "--channel", "ramp", "--points", points});
  ASSERT_EQ(run.code, 0) << run.err;
  EXPECT_EQ(run.err, "");
  std::istringstream lines(run.out);
  std::string line;
  std::getline(lines, line);
  for (auto const& p : places) {
    double row[7] = {};
    ASSERT_TRUE(std::getline(lines, line));
    std::istringstream cells(line);
    for (double& number : row) {
      std::string cell;
      std::getline(cells, cell, ',');
      number = std::stod(cell);
    }
    for (int a = 0; a < 3; ++a) EXPECT_NEAR(row[a], p[a], 1e-7);
    EXPECT_NEAR(row[3], rampAt(p), 1e-4) << line;
    EXPECT_NEAR(row[4], 2, 1e-4) << line;
    EXPECT_NEAR(row[5], -1, 1e-4) << line;
    EXPECT_NEAR(row[6], 0.5, 1e-4) << line;
  }

  // The middle of the box lies at index (3.5, 7.5, 15.5): along z the position is 2 + 0.25 * 15.5.
  std::string const picture = m_folder / "turned.png";
  RunResult const slice = vln({"slice", path, "--channel", "ramp", "--axis", "z", "--at", "5.875",
                               "--gradient", "--size", "64", "-o", picture});
  ASSERT_EQ(slice.code, 0) << slice.err;
  EXPECT_NE(slice.out.find("z = 5.875"), std::string::npos) << slice.out;
}

// requirement: --depth draws coarser tiles
TEST_F(ProgramTest, SliceStopsAtADepth) {
  std::string const path = torus();
  std::vector<std::string> pictures;
  for (char const* depth : {"28", "27", "26"}) {
    std::string const picture = m_folder / (std::string(depth) + ".png");
    RunResult const run = vln({"slice", path, "--channel", "surface", "--axis", "z", "--size", "100",
                               "--depth", depth, "-o", picture});
    ASSERT_EQ(run.code, 0) << run.err;
    pictures.push_back(readAll(picture));
  }
  EXPECT_NE(pictures[0], pictures[1]);
  EXPECT_NE(pictures[1], pictures[2]);
  std::string const whole = m_folder / "whole.png";
  vln({"slice", path, "--channel", "surface", "--axis", "z", "--size", "100", "-o", whole});
  EXPECT_EQ(readAll(whole), pictures[0]);
  EXPECT_NE(vln({"slice", path, "--channel", "surface", "--axis", "z", "--depth", "29", "-o", whole}).code,
            0);
}

// negative
TEST_F(ProgramTest, ProbeNamesBadPoints) {
  std::string const path = torus(), points = m_folder / "points.csv";
  for (char const* bad : {"1,2", "1,2,3,4", "x,y,z", "1,2,3 4", "1;2;3", ",,", "1,2,"}) {
    writeAll(points, std::string("1,2,3\n") + bad + "\n");
    expectFailure(vln({"probe", path, "--channel", "surface", "--points", points}),
                  points + ": line 2 is not of the form x,y,z");
  }
  expectFailure(vln({"probe", path, "--channel", "surface", "--points", m_folder / "none.csv"}),
                (m_folder / "none.csv") + ": No such file or directory");
  expectFailure(vln({"probe", path, "--channel", "surface", "--points", m_folder.path()}),
                m_folder.path() + ": is a directory");
  expectFailure(vln({"probe", path, "--channel", "density", "1", "2", "3"}),
                path + ": has no channel 'density'; it has surface");
}

// requirement
TEST_F(ProgramTest, MakeIsRepeatable) {
  std::string const a = m_folder / "a.vdb", b = m_folder / "b.vdb";
  for (char const* shape : {"cloud", "torus"}) {
    ASSERT_EQ(vln({"make", shape, a, "--voxels", "5000"}).code, 0);
    ASSERT_EQ(vln({"make", shape, b, "--voxels", "5000"}).code, 0);
    EXPECT_TRUE(readAll(a) == readAll(b)) << shape;
  }
  EXPECT_EQ(m_folder.names().size(), 2u);
}

// negative
TEST_F(ProgramTest, BadFilesEndInOneLine) {
  std::string const missing = m_folder / "missing.vdb", foreign = m_folder / "foreign.vdb",
                    picture = m_folder / "p.png";
  writeAll(foreign, "certainly no volume");
  std::string const whole = torus(), cut = m_folder / "cut.vdb";
  writeAll(cut, readAll(whole).substr(0, 10000));
  struct Case {
    std::string file, reason;
  };
  for (Case const& c : {Case{missing, "No such file or directory"}, Case{foreign, "is not an OpenVDB file"},
                        Case{m_folder.path(), "is a directory"},
                        Case{cut, "is truncated or damaged: data that it announces is missing"}}) {
    expectFailure(vln({"info", c.file}), c.file + ": " + c.reason);
    expectFailure(vln({"info", c.file, "--json"}), c.file + ": " + c.reason);
    expectFailure(vln({"slice", c.file, "--channel", "surface", "--axis", "x", "-o", picture}),
                  c.file + ": " + c.reason);
  }
  std::string const large = m_folder / "large.vdb";
  ASSERT_EQ(vln({"make", "torus", large, "--voxels", "400000"}).code, 0);
  // Which bound is met first, that of the reading or that of the volumes, depends on the build.
  RunResult const bounded = vln({"info", large, "--max-memory", "1"});
  EXPECT_EQ(bounded.code, 1);
  EXPECT_EQ(bounded.out, "");
  EXPECT_NE(bounded.err.find("more than 1 MB of memory\n"), std::string::npos) << bounded.err;
  EXPECT_FALSE(std::filesystem::exists(picture));
}

// negative
TEST_F(ProgramTest, WhatCannotBeDrawnEndsInOneLine) {
  std::string const path = torus(), picture = m_folder / "p.png";
  expectFailure(vln({"slice", path, "--channel", "density", "--axis", "x", "-o", picture}),
                path + ": has no channel 'density'; it has surface");
  RunResult const off =
      vln({"slice", path, "--channel", "surface", "--axis", "x", "--at", "77", "-o", picture});
  EXPECT_EQ(off.code, 1);
  EXPECT_NE(off.err.find("position 77 on axis x misses the active voxels"), std::string::npos) << off.err;
  expectFailure(vln({"slice", path, "--channel", "surface", "--axis", "x", "-o", m_folder / "no/p.png"}),
                (m_folder / "no/p.png") + ": cannot be written: No such file or directory");
  expectFailure(vln({"make", "cloud", m_folder.path()}), m_folder.path() + ": is a directory");
  EXPECT_EQ(m_folder.names(), std::vector<std::string>{"torus.vdb"});
}

// negative
TEST_F(ProgramTest, BadOptionsEndInOneLine) {
  std::vector<std::vector<std::string>> const cases = {
      {},
      {"frobnicate"},
      {"info"},
      {"info", "a.vdb", "--frob"},
      {"slice", "a.vdb", "b.vdb"},
      {"slice", "a.vdb"},
      {"slice", "a.vdb", "--channel", "d", "--axis", "w", "-o", "p.png"},
      {"slice", "a.vdb", "--channel", "d", "--axis", "x", "--size", "9", "-o", "p.png"},
      {"slice", "a.vdb", "--channel", "d", "--axis", "x", "--at", "here", "-o", "p.png"},
      {"slice", "a.vdb", "--channel", "d", "--axis", "x", "--nearest", "--gradient", "-o", "p.png"},
      {"probe", "a.vdb", "--channel", "d"},
      {"probe", "a.vdb", "--channel", "d", "1", "2"},
      {"probe", "a.vdb", "--channel", "d", "1", "2", "three"},
      {"probe", "a.vdb", "1", "2", "3"},
      {"make", "cube", "a.vdb"},
      {"make", "cloud", "a.vdb", "--voxels", "-5"},
      {"make", "cloud", "a.vdb", "--voxels", "many"},
      {"info", "a.vdb", "--max-memory", "0"},
  };
  for (auto const& arguments : cases) {
    RunResult const run = vln(arguments);
    std::string const line = arguments.empty() ? "" : arguments.back();
    EXPECT_EQ(run.code, 1) << line;
    EXPECT_EQ(run.out, "") << line;
    EXPECT_EQ(std::count(run.err.begin(), run.err.end(), '\n'), 1) << line << "\n" << run.err;
    EXPECT_EQ(run.err.rfind("vln: ", 0), 0u) << run.err;
  }
}

// boundary: a full disk is an error, not a silence
TEST_F(ProgramTest, TellsThatItsOutputIsLost) {
  if (!std::filesystem::exists("/dev/full")) GTEST_SKIP() << "no /dev/full";
  std::string const path = torus();
  RunResult const run =
      runProgram({"/bin/sh", "-c", std::string("'") + VLN_PROGRAM + "' info '" + path + "' > /dev/full"});
  EXPECT_EQ(run.code, 1);
  EXPECT_EQ(run.err, "vln: standard output cannot be written\n");
}

class RealFile : public testing::TestWithParam<char const*> {};

// requirement: info and slice on every file of the shared data
TEST_P(RealFile, IsReportedAndDrawn) {
  std::string const path = dataFile(std::string("vdb/") + GetParam());
  if (path.empty()) GTEST_SKIP() << "no shared test data";
  TempFolder folder;
  RunResult const run = vln({"info", path, "--json"});
  ASSERT_EQ(run.code, 0) << run.err;
  Json const j = Json::parse(run.out);
  int drawn = 0;
  for (Json const& object : j["objects"])
    for (Json const& channel : object["channels"]) {
      if (channel["active"] != 0 && ++drawn > 4) continue; // one file has two dozen
      std::string const name = channel["name"], picture = folder / "p.png";
      if (name == "positions") continue; // points have no plane to draw
      RunResult const slice =
          vln({"slice", path, "--channel", name, "--axis", "z", "--size", "200", "-o", picture});
      if (channel["active"] == 0) {
        expectFailure(slice, path + ": channel '" + name + "' has no active voxel");
        continue;
      }
      ASSERT_EQ(slice.code, 0) << slice.err;
      EXPECT_GT(distinctColors(readPng(picture)), 20) << name;
    }
  for (Json const& skipped : j["skipped"])
    EXPECT_NE(skipped["reason"].get<std::string>().find("are not read"), std::string::npos);
}

INSTANTIATE_TEST_SUITE_P(Shared, RealFile, realVolumes(), volumeName);

} // namespace
