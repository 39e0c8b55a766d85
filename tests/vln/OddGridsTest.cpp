// Files with grids beyond those of floats.
#include "Interop/VdbTypesImpl.h"
#include "support/VdbCompare.h"
#include "support/VlnProgram.h"

#include <openvdb/points/PointConversion.h>

namespace {

using namespace VLN::Test;
using Json = nlohmann::ordered_json;

template <class GridT>
typename GridT::Ptr gridOf(std::string const& name, typename GridT::ValueType const& background,
                           typename GridT::ValueType const& low, typename GridT::ValueType const& high) {
  auto grid = GridT::create(background);
  grid->setName(name);
  grid->tree().setValueOn({0, 0, 0}, low);
  grid->tree().setValueOn({1, 0, 0}, high);
  return grid;
}

openvdb::GridBase::Ptr pointsGrid() {
  std::vector<openvdb::Vec3d> const positions{{0.25, 0.5, 0.75}, {10, 11, 12}, {-3, 4, -5}};
  auto const transform = openvdb::math::Transform::createLinearTransform(0.5);
  openvdb::points::PointAttributeVector<openvdb::Vec3d> const wrapper(positions);
  auto const index =
      openvdb::tools::createPointIndexGrid<openvdb::tools::PointIndexGrid>(wrapper, *transform);
  auto grid =
      openvdb::points::createPointDataGrid<openvdb::points::NullCodec, openvdb::points::PointDataGrid>(
          *index, wrapper, *transform);
  grid->setName("cloud");
  return grid;
}

class OddGridsTest : public testing::Test {
protected:
  OddGridsTest() { openvdb::initialize(); }
  std::string file(openvdb::GridPtrVec const& grids, openvdb::MetaMap const& metadata = {}) {
    std::string const path = m_folder / "odd.vdb";
    openvdb::io::File(path).write(grids, metadata);
    return path;
  }
  std::vector<std::string> channels(std::string const& path) {
    std::vector<std::string> names;
    RunResult const run = vln({"info", path, "--json"});
    EXPECT_EQ(run.code, 0) << run.err;
    Json const report = Json::parse(run.out);
    for (Json const& object : report["objects"])
      for (Json const& channel : object["channels"]) names.push_back(channel["name"]);
    return names;
  }
  TempFolder m_folder;
};

// regression: probe crashed on every type but float
TEST_F(OddGridsTest, RegressionProbePrintsAllTypes) {
  std::int64_t const big = (std::int64_t(1) << 60) + 1;
  std::string const path =
      file({gridOf<openvdb::BoolGrid>("flag", false, true, true),
            gridOf<openvdb::Int32Grid>("count", 7, -5, 9), gridOf<openvdb::Int64Grid>("id", 0, big, big + 2),
            gridOf<openvdb::Vec3fGrid>("v", {0, 0, 0}, {1, 2, 3}, {3, 2, -1}),
            gridOf<openvdb::Vec3dGrid>("w", {0, 0, 0}, {0.1, 2, 3}, {0.1, 2, -1})});
  auto const probe = [&](char const* channel, std::vector<std::string> where) {
    where.insert(where.begin(), {"probe", path, "--channel", channel});
    RunResult const run = vln(where);
    EXPECT_EQ(run.code, 0) << run.err << run.signal;
    EXPECT_EQ(run.err, "");
    return run.out;
  };
  EXPECT_EQ(probe("flag", {"0.4", "0", "0", "5", "5", "5"}), "x,y,z,value\n0.4,0,0,1\n5,5,5,0\n");
  EXPECT_EQ(probe("count", {"0.4", "0", "0", "0.6", "0", "0", "99", "0", "0"}),
            "x,y,z,value\n0.4,0,0,-5\n0.6,0,0,9\n99,0,0,7\n");
  EXPECT_EQ(probe("id", {"0", "0", "0", "1", "0", "0"}),
            "x,y,z,value\n0,0,0,1152921504606846977\n1,0,0,1152921504606846979\n");
  EXPECT_EQ(probe("v", {"0.25", "0", "0"}), "x,y,z,value_x,value_y,value_z\n0.25,0,0,1.5,2,2\n");
  EXPECT_EQ(probe("w", {"0.5", "0", "0"}),
            "x,y,z,value_x,value_y,value_z\n0.5,0,0,0.10000000000000001,2,1\n");
  EXPECT_EQ(probe("v", {"1e300", "0", "0"}), "x,y,z,value_x,value_y,value_z\n1e+300,0,0,0,0,0\n");
}

// requirement: positions from a pipe, with a header or without, answered as they come
TEST_F(OddGridsTest, RequirementProbeReadsStandardInput) {
  std::string const path = file({gridOf<openvdb::Int32Grid>("count", 7, -5, 9)});
  std::string const program = std::string("'") + VLN_PROGRAM + "' probe '" + path + "' --channel count ";
  for (std::string const dash : {"-", "--points -"}) {
    RunResult const run =
        runProgram({"/bin/sh", "-c",
                    "(printf 'px, py ,pz\\n0,0,0\\n1,0'; sleep 0.2; printf ',0\\n') | " + program + dash});
    EXPECT_EQ(run.code, 0) << run.err;
    EXPECT_EQ(run.out, "x,y,z,value\n0,0,0,-5\n1,0,0,9\n");
  }
  RunResult const asked = runProgram({"/bin/bash", "-c",
                                      "coproc P { " + program +
                                          "-; }; read -u ${P[0]} header; "
                                          "echo 1,0,0 >&${P[1]}; read -t 60 -u ${P[0]} line; echo $line; "
                                          "exec {P[1]}>&-; wait"});
  EXPECT_EQ(asked.out, "1,0,0,9\n") << asked.err;
  std::string const csv = m_folder / "out.csv";
  EXPECT_EQ(vln({"probe", path, "--channel", "count", "0", "0", "0", "-o", csv}).code, 0);
  EXPECT_EQ(readAll(csv), "x,y,z,value\n0,0,0,-5\n");
  expectFailure(runProgram({"/bin/sh", "-c", "echo 1,2,oops | " + program + "-o '" + csv + "' -"}),
                "standard input: line 1 is not of the form x,y,z");
  EXPECT_EQ(readAll(csv), "x,y,z,value\n0,0,0,-5\n");
}

// regression: OpenVDB's log lay before the report
TEST_F(OddGridsTest, RegressionOpenvdbDoesNotSpoilTheReport) {
  std::string const path = file({gridOf<openvdb::FloatGrid>("f", 0, 1, 2)});
  std::string bytes = readAll(path);
  ASSERT_EQ(bytes[8], char(openvdb::OPENVDB_FILE_VERSION));
  bytes[8] = static_cast<char>(bytes[8] + 1); // as a later version would write it
  writeAll(path, bytes);
  RunResult const json = vln({"info", path, "--json"});
  EXPECT_EQ(json.code, 0);
  EXPECT_TRUE(Json::accept(json.out)) << json.out;
  EXPECT_EQ(json.err.rfind("vln: note: OpenVDB: WARN: unsupported VDB file format", 0), 0u) << json.err;
  EXPECT_EQ(std::count(json.err.begin(), json.err.end(), '\n'), 1) << json.err;
  EXPECT_EQ(vln({"probe", path, "--channel", "f", "0", "0", "0"}).out.rfind("x,y,z,value", 0), 0u);
}

// regression: the names are those of properties that the importer sets
TEST_F(OddGridsTest, RegressionNamesOfPropertiesTravel) {
  openvdb::MetaMap metadata;
  metadata.insertMeta("author", openvdb::StringMetadata("nobody"));
  openvdb::GridPtrVec grids;
  for (char const* name :
       {"vdb_grids", "vdb_metadata", "vdb_transform", "voxel_tile_tree", "voxel_component"})
    grids.push_back(gridOf<openvdb::FloatGrid>(name, 0, 1, 2));
  std::string const path = file(grids, metadata), copy = m_folder / "copy.vdb";
  RunResult const run = vln({"convert", path, copy, "--strict"});
  ASSERT_EQ(run.code, 0) << run.err;
  openvdb::io::File written(copy);
  written.open();
  for (auto const& grid : grids) {
    auto const again = openvdb::gridPtrCast<openvdb::FloatGrid>(written.readGrid(grid->getName()));
    EXPECT_EQ(again->tree().getValue({1, 0, 0}), 2.0f);
  }
  EXPECT_EQ(written.getMetadata()->metaValue<std::string>("author"), "nobody");
}

// regression: one grid of an unknown type made the file unreadable
TEST_F(OddGridsTest, RegressionUnknownTypesAreSkippedByName) {
  using Unknown = openvdb::Grid<openvdb::tree::Tree4<float, 3, 2, 2>::Type>;
  Unknown::registerGrid();
  std::string const path =
      file({gridOf<openvdb::FloatGrid>("first", 0, 1, 2), gridOf<Unknown>("odd", 0, 1, 2),
            gridOf<openvdb::FloatGrid>("last", 0, 3, 4)});
  Unknown::unregisterGrid();
  EXPECT_EQ(channels(path), (std::vector<std::string>{"first", "last"}));
  std::string const copy = m_folder / "copy.vdb";
  RunResult const run = vln({"convert", path, copy});
  EXPECT_EQ(run.code, 0);
  EXPECT_EQ(run.err,
            "vln: " + path + ": note: 'odd' is left out: grids of type Tree_float_3_2_2 are not read\n");
  EXPECT_EQ(run.out, copy + ": 2 grids written\n");
  std::filesystem::remove(copy);
  expectFailure(vln({"convert", path, copy, "--strict"}),
                path + ": would not be written whole; 'odd': grids of type Tree_float_3_2_2 are not read");
  EXPECT_FALSE(std::filesystem::exists(copy));

  // Cut within the unknown grid, the file is still told to be damaged.
  std::string const whole = readAll(path), cut = m_folder / "cut.vdb";
  writeAll(cut, whole.substr(0, whole.find("Tree_float_3_2_2") + 60));
  EXPECT_EQ(vln({"info", cut}).code, 1);
}

// regression: integers and doubles went through float
TEST_F(OddGridsTest, RegressionInfoPrintsNumbersExactly) {
  auto grid = gridOf<openvdb::Int32Grid>("count", 16777217, -16777219, 123456789);
  grid->setTransform(openvdb::math::Transform::createLinearTransform(0.1));
  grid->transform().postTranslate(openvdb::Vec3d(4500000.125, 0, 0));
  grid->setGridClass(openvdb::GRID_FOG_VOLUME);
  grid->insertMeta("D\u00fcse", openvdb::StringMetadata("\u96f2"));
  std::string const path = file({grid});
  RunResult const json = vln({"info", path, "--json"});
  Json const object = Json::parse(json.out)["objects"][0];
  Json const& channel = object["channels"][0];
  EXPECT_EQ(channel["min"], -16777219);
  EXPECT_EQ(channel["max"], 123456789);
  EXPECT_TRUE(channel["min"].is_number_integer());
  EXPECT_EQ(channel["background"], 16777217);
  EXPECT_EQ(channel["class"], "fog volume");
  EXPECT_EQ(channel["metadata"]["D\u00fcse"], "\u96f2");
  EXPECT_EQ(object["voxel_size"], 0.1);
  EXPECT_EQ(object["active_box"], Json::parse("[[0,0,0],[1,0,0]]"));
  EXPECT_EQ(object["active_world_bounds"][0][0], 4500000.125);
  EXPECT_NEAR(object["active_world_bounds"][1][0].get<double>(), 4500000.225, 1e-9);
  EXPECT_EQ(object["matrix"][0], Json::parse("[0.1,0.0,0.0,4500000.125]"));
  EXPECT_NE(json.out.find("D\u00fcse"), std::string::npos);
  RunResult const text = vln({"info", path});
  EXPECT_NE(text.out.find("from (4500000.125, 0, 0) to (4500000.225, 0, 0)"), std::string::npos) << text.out;
  EXPECT_NE(text.out.find("count: fog volume, background 16777217"), std::string::npos) << text.out;
  EXPECT_NE(text.out.find("D\u00fcse: \u96f2"), std::string::npos) << text.out;
}

// requirement: several files, patterns, and a bad one among them
TEST_F(OddGridsTest, RequirementInfoTakesSeveralFiles) {
  std::string const path = file({gridOf<openvdb::FloatGrid>("a", 0, 1, 2), pointsGrid()});
  std::filesystem::copy(path, m_folder / "two.vdb");
  writeAll(m_folder / "bad.vdb", "no volume");
  RunResult const brief = vln({"info", "--brief", m_folder / "*.vdb"});
  EXPECT_EQ(brief.code, 1);
  EXPECT_EQ(brief.err, "vln: " + (m_folder / "bad.vdb") + ": is not an OpenVDB file\n");
  EXPECT_EQ(std::count(brief.out.begin(), brief.out.end(), '\n'), 2);
  EXPECT_EQ(brief.out.rfind(path + ": a (float), cloud (points); 5 active; ", 0), 0u) << brief.out;
  Json const both = Json::parse(vln({"info", "--json", path, m_folder / "two.vdb"}).out);
  ASSERT_EQ(both.size(), 2u);
  EXPECT_EQ(both[1]["file"], m_folder / "two.vdb");
}

// requirement
TEST_F(OddGridsTest, RequirementPointsAloneAreConverted) {
  std::string const path = file({pointsGrid()}), copy = m_folder / "copy.vdb";
  RunResult const run = vln({"convert", path, copy, "--strict"});
  ASSERT_EQ(run.code, 0) << run.err;
  EXPECT_EQ(run.out, copy + ": 1 grid written\n");
  Json a = Json::parse(vln({"info", path, "--json"}).out), b = Json::parse(vln({"info", copy, "--json"}).out);
  a.erase("file"), b.erase("file");
  EXPECT_EQ(a["objects"][0]["channels"], b["objects"][0]["channels"]);
  EXPECT_EQ(a["objects"][0]["world_bounds"], b["objects"][0]["world_bounds"]);
}

// requirement: masks keep their voxels and tiles
TEST_F(OddGridsTest, RequirementMasksTravel) {
  auto mask = openvdb::MaskGrid::create();
  mask->setName("mask");
  mask->setTransform(openvdb::math::Transform::createLinearTransform(0.25));
  mask->insertMeta("note", openvdb::StringMetadata("kept"));
  mask->tree().addTile(1, {8, 0, 0}, true, true);
  mask->tree().addTile(2, {256, 0, 0}, true, true);
  for (int n = 0; n < 40; ++n) mask->tree().setValueOn({n * 7 % 30 - 60, n * 5 % 11, n});
  std::string const path = file({mask, gridOf<openvdb::FloatGrid>("f", 0, 1, 2)}),
                    copy = m_folder / "copy.vdb";
  ASSERT_EQ(vln({"convert", path, copy, "--strict"}).code, 0);
  openvdb::io::File written(copy);
  written.open();
  auto const again = openvdb::gridPtrCast<openvdb::MaskGrid>(written.readGrid("mask"));
  ASSERT_TRUE(again);
  EXPECT_TRUE(again->tree().hasSameTopology(mask->tree()));
  EXPECT_EQ(again->tree().activeTileCount(), mask->tree().activeTileCount());
  EXPECT_EQ(again->transform(), mask->transform());
  EXPECT_EQ(again->metaValue<std::string>("note"), "kept");
  Json const j = Json::parse(vln({"info", path, "--json"}).out);
  EXPECT_EQ(j["objects"][0]["channels"][0]["type"], "mask");
  EXPECT_EQ(j["objects"][0]["channels"][0]["active"], std::int64_t(mask->activeVoxelCount()));
}

} // namespace
