// Boxes of tiles and points as OBJ files.
#include "GeometryVolume/debug/DumpObj.h"
#include "GeometryVolume/tiletree/Container.h"
#include "support/Shapes.h"
#include "support/TempFolder.h"

#include <filesystem>
#include <fstream>
#include <sstream>

using namespace VLN::TileTree3D;
using Velorn::Math::float3;
using Velorn::Math::int3;

namespace {

using Lines = std::vector<std::string>;

Lines linesOf(std::filesystem::path const& file) {
  std::ifstream in(file);
  Lines lines;
  for (std::string line; std::getline(in, line);) lines.push_back(line);
  return lines;
}
Lines startingWith(Lines const& lines, std::string const& start) {
  Lines result;
  for (auto const& line : lines) {
    if (line.compare(0, start.size(), start) == 0) result.push_back(line);
  }
  return result;
}
/// The numbers behind a line's first word.
template <class T> std::vector<T> numbers(std::string const& line) {
  std::istringstream in(line);
  std::string word;
  in >> word;
  std::vector<T> result;
  for (T value; in >> value;) result.push_back(value);
  return result;
}
std::vector<int> facesFrom(int b) {
  return {b, b + 1, b + 5, b + 4, b + 1, b + 3, b + 7, b + 5, b + 4, b + 5, b + 7, b + 6,
          b, b + 4, b + 6, b + 2, b + 1, b,     b + 2, b + 3, b + 3, b + 2, b + 6, b + 7};
}
std::vector<int> allFaces(Lines const& lines) {
  std::vector<int> result;
  for (auto const& line : startingWith(lines, "f ")) {
    auto const face = numbers<int>(line);
    result.insert(result.end(), face.begin(), face.end());
  }
  return result;
}

/// Works in a folder of its own: the materials go to the current one.
template <class TraitsT> class DumpObj : public ::testing::Test {
public:
  DumpObj()
      : m_old(std::filesystem::current_path()) {
    std::filesystem::current_path(m_folder.path());
  }
  ~DumpObj() override { std::filesystem::current_path(m_old); }

private:
  std::filesystem::path m_old;
  VLN::Test::TempFolder m_folder;
};
TYPED_TEST_SUITE(DumpObj, Support::Shapes, Support::ShapeNames);

TYPED_TEST(DumpObj, ADepthWithoutTilesGivesTheFirstLineAndTheMaterials) {
  Container<TypeParam> const tree("tree", 1.0f);
  for (int const depth : {0, 12, TypeParam::kMaxDepth, -2, 40}) {
    std::filesystem::remove("tile_tree.mtl");
    tree.dumpObj("empty.obj", depth);
    EXPECT_EQ(linesOf("empty.obj"), Lines{"mtllib tile_tree.mtl"});
    EXPECT_EQ(linesOf("tile_tree.mtl"),
              (Lines{"newmtl RED", "Ka 0.914 0.813 0.664", "Kd 0.914 0.813 0.664", "Ks 0.914 0.813 0.664",
                     "newmtl GREEN", "Ka 0.828 0.684 0.547", "Kd 0.828 0.684 0.547", "Ks 0.828 0.684 0.547",
                     "newmtl BLUE", "Ka 0.719 0.461 0.297", "Kd 0.719 0.461 0.297", "Ks 0.719 0.461 0.297"}));
  }
}

TYPED_TEST(DumpObj, TilesOfTheAskedDepthBecomeBoxes) {
  for (int const depth : {3, TypeParam::kMaxDepth - 1, TypeParam::kMaxDepth}) {
    Container<TypeParam> tree("tree", 0.25f);
    auto accessor = tree.tileAccessor();
    int3 const corner = accessor.addTile(9, -20, 3, depth).tijk();
    int const w = TypeParam::width(depth);
    accessor.addTile(corner.x + w, corner.y, corner.z, depth); // next along i
    accessor.addTile(corner.x, corner.y + w, corner.z + w, depth);
    accessor.addTile(9, -20, 3, depth - 1); // another depth
    tree.dumpObj("tiles.obj", depth);
    Lines const lines = linesOf("tiles.obj");
    EXPECT_EQ(lines.size(), 1u + 3 * (8 + 1 + 6));
    EXPECT_EQ(lines[0], "mtllib tile_tree.mtl");
    for (std::size_t n = 1; n <= 24; ++n) EXPECT_EQ(lines[n].compare(0, 2, "v "), 0) << "vertices come first";

    auto const vertices = startingWith(lines, "v ");
    ASSERT_EQ(vertices.size(), 24u);
    int3 const corners[3] = {
        corner, {corner.x + w, corner.y, corner.z}, {corner.x, corner.y + w, corner.z + w}};
    for (int n = 0; n < 24; ++n) {
      int3 const& c = corners[n / 8];
      std::vector<float> const expected = {0.25f * static_cast<float>(c.x + (n & 1 ? w : 0)),
                                           0.25f * static_cast<float>(c.y + (n & 2 ? w : 0)),
                                           0.25f * static_cast<float>(c.z + (n & 4 ? w : 0))};
      EXPECT_EQ(numbers<float>(vertices[static_cast<std::size_t>(n)]), expected) << n;
    }
    std::vector<int> faces;
    for (int const b : {1, 9, 17}) {
      auto const box = facesFrom(b);
      faces.insert(faces.end(), box.begin(), box.end());
    }
    EXPECT_EQ(allFaces(lines), faces);

    static std::string const kNames[] = {"usemtl RED", "usemtl GREEN", "usemtl BLUE"};
    auto const uses = startingWith(lines, "usemtl");
    ASSERT_EQ(uses.size(), 3u);
    for (int n = 0; n < 3; ++n) {
      std::int64_t sum = 0;
      for (int a = 0; a < 3; ++a)
        sum += (static_cast<std::int64_t>(corners[n][a]) - TypeParam::kMinTileCoord) / w;
      EXPECT_EQ(uses[static_cast<std::size_t>(n)], kNames[sum % 3]);
    }
    EXPECT_NE(uses[0], uses[1]) << "neighbours differ";
  }
}

TYPED_TEST(DumpObj, TheLowestTileOfTheDomainIsRed) {
  constexpr int low = TypeParam::kMinTileCoord;
  for (int const depth : {0, 5, TypeParam::kMaxDepth}) {
    Container<TypeParam> tree("tree", 1.0f);
    tree.tileAccessor().addTile(low, low, low, depth);
    tree.dumpObj("low.obj", depth);
    EXPECT_EQ(startingWith(linesOf("low.obj"), "usemtl"), Lines{"usemtl RED"});
  }
}

TYPED_TEST(DumpObj, DeadTilesAreLeftOut) {
  Container<TypeParam> tree("tree", 1.0f);
  auto accessor = tree.tileAccessor();
  for (int n = 0; n < 3; ++n) accessor.addTile(100 * n, 0, 0, TypeParam::kMaxDepth);
  tree.setCompactOnRemoval(false);
  accessor.removeTile({1, TypeParam::kMaxDepth}, true);
  tree.dumpObj("dead.obj", TypeParam::kMaxDepth);
  EXPECT_EQ(startingWith(linesOf("dead.obj"), "usemtl").size(), 2u);
}

TYPED_TEST(DumpObj, AFileThatCannotBeWrittenIsNoError) {
  Container<TypeParam> tree("tree", 1.0f);
  tree.tileAccessor().addTile(0, 0, 0, 3);
  tree.dumpObj("no/such/folder/tiles.obj", 3);
  EXPECT_FALSE(std::filesystem::exists("no"));
  EXPECT_TRUE(std::filesystem::exists("tile_tree.mtl"));
}

TYPED_TEST(DumpObj, PointsBecomeCubes) {
  Container<TypeParam> tree("tree", 1.0f);
  auto accessor = tree.tileAccessor();
  for (int n = 0; n < 3; ++n) accessor.addTile(100 * n, 0, 0, TypeParam::kMaxDepth);
  constexpr int kW = TypeParam::kTileDataWidth;
  Channel<TypeParam, float3, kW, 0> points("points", nullptr, kInitializeDefaultValue, false, true, 0, 28);
  points.enableAllocateEmptyTileData();
  points.update(tree);
  // The tile between stays empty.
  points.tileDataAccessor().tileData({0, TypeParam::kMaxDepth}).push({1, 2, 3});
  points.tileDataAccessor().tileData({2, TypeParam::kMaxDepth}).push({-200.5f, 0.1f, 1e7f});
  ::Test::dumpObj<TypeParam>(points, 0.5f, "points.obj");
  Lines const lines = linesOf("points.obj");
  ASSERT_EQ(lines.size(), 2u * 14);
  EXPECT_EQ(startingWith(lines, "usemtl").size() + startingWith(lines, "mtllib").size(), 0u);
  EXPECT_EQ(lines[0], "v 0.5 1.5 2.5");
  EXPECT_EQ(lines[7], "v 1.5 2.5 3.5");
  EXPECT_EQ(lines[8], "f 1 2 6 5");
  EXPECT_EQ(numbers<float>(lines[14]), (std::vector<float>{-201.0f, 0.1f - 0.5f, 1e7f - 0.5f}));
  EXPECT_EQ(numbers<float>(lines[21]), (std::vector<float>{-200.0f, 0.1f + 0.5f, 1e7f + 0.5f}));
  auto faces = facesFrom(1);
  auto const second = facesFrom(9);
  faces.insert(faces.end(), second.begin(), second.end());
  EXPECT_EQ(allFaces(lines), faces);
}

} // namespace
