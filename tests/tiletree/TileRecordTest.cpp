// The tile as a record: defaults, life of the child table, self-checks and dumps.
#include "support/CaptureStream.h"
#include "support/ContainerAccess.h"
#include "support/Print.h"
#include "support/Shapes.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <limits>
#include <vector>

using namespace VLN::TileTree3D;
using Support::OpenTile;

VLN_SHAPE_SUITE(TileRecord);

// boundary
TYPED_TEST(TileRecord, DefaultIsDeadAndOutsideAnyTree) {
  Tile<TypeParam, TypeParam::kTileSize> const t;
  EXPECT_EQ(t.depth(), -1);
  EXPECT_EQ(t.index(), -1);
  EXPECT_EQ(t.parentIndex(), -1);
  EXPECT_EQ(t.branchSize(), TypeParam::kTileSize);
  EXPECT_FALSE(t.valid());
  EXPECT_EQ(t.children(), nullptr);
  EXPECT_EQ(t.treeIndex(), TreeIndex{});
  EXPECT_TRUE(t.isOK());
  EXPECT_FALSE(t.hasLeaves());
  EXPECT_TRUE(t.begin() == t.end());
  EXPECT_TRUE(t.rbegin() == t.rend());
}

// requirement
TYPED_TEST(TileRecord, InitMakesALiveTileWithAnEmptyTable) {
  using T = TypeParam;
  OpenTile<T> const t(T::kMinTileCoord, T::kMinTileCoord, T::kMinTileCoord, 3, 7, 4);
  EXPECT_TRUE(t.valid());
  EXPECT_EQ(t.depth(), 3);
  EXPECT_EQ(t.index(), 7);
  EXPECT_EQ(t.parentIndex(), 4);
  EXPECT_EQ(t.treeIndex(), (TreeIndex{7, 3}));
  EXPECT_EQ(t.parentTreeIndex(), (TreeIndex{4, 2}));
  EXPECT_EQ(t.branchSize(), T::kTileSize);
  EXPECT_FALSE(t.isRoot());
  EXPECT_FALSE(t.atMaxDepth());
  ASSERT_NE(t.children(), nullptr);
  for (int slot = 0; slot < T::kTileSize; ++slot) {
    EXPECT_EQ(t.childIndex(slot), -1);
    EXPECT_TRUE(t.isLeaf(slot));
    EXPECT_EQ(t.childTreeIndex(slot), (TreeIndex{-1, 4}));
  }
  EXPECT_TRUE(t.isLeaf());
  EXPECT_TRUE(t.hasLeaves());
  EXPECT_EQ(t.childCount(), 0);
}

// boundary
TYPED_TEST(TileRecord, InitAtTheDeepestDepthLeavesTheTableNull) {
  using T = TypeParam;
  OpenTile<T> const t(T::kMinTileCoord, T::kMinTileCoord, T::kMinTileCoord, T::kMaxDepth, 0, 0);
  EXPECT_EQ(t.children(), nullptr);
  EXPECT_TRUE(t.atMaxDepth());
  EXPECT_TRUE(t.isLeaf());
  EXPECT_TRUE(t.isLeaf(0));
  EXPECT_TRUE(t.isLeaf(int3{1, 1, 1}));
  EXPECT_TRUE(t.hasLeaves());
  EXPECT_EQ(t.childCount(), 0);
  EXPECT_TRUE(t.begin() == t.end());
  EXPECT_EQ(*t.begin(), T::kTileSize);
  EXPECT_TRUE(t.rbegin() == t.rend());
  EXPECT_EQ(*t.rbegin(), -1);
}

// requirement
TYPED_TEST(TileRecord, CopiesOwnTheirTables) {
  using T = TypeParam;
  OpenTile<T> source(T::kMinTileCoord, T::kMinTileCoord, T::kMinTileCoord, 1);
  source.childIndex(3) = 42;
  source.setBranchSize(99);
  OpenTile<T> const copy(source);
  ASSERT_NE(copy.children(), source.children());
  source.childIndex(3) = 1;
  EXPECT_EQ(copy.childIndex(3), 42);
  EXPECT_EQ(copy.branchSize(), 99);
  EXPECT_EQ(copy.treeIndex(), source.treeIndex());
}

// requirement
TYPED_TEST(TileRecord, MoveConstructionLeavesTheSourceWhole) {
  using T = TypeParam;
  OpenTile<T> source(0, 0, 0, 1);
  source.childIndex(3) = 42;
  OpenTile<T> const moved(std::move(source));
  ASSERT_NE(source.children(), nullptr); // NOLINT: the move is a copy
  EXPECT_NE(moved.children(), source.children());
  EXPECT_EQ(source.childIndex(3), 42);
  EXPECT_EQ(moved.childIndex(3), 42);
  EXPECT_TRUE(source.valid());
}

// requirement
TYPED_TEST(TileRecord, AssignmentKeepsTheSourcesTable) {
  using T = TypeParam;
  OpenTile<T> source(0, 0, 0, 1), target;
  source.childIndex(0) = 5;
  target = source;
  ASSERT_NE(target.children(), nullptr);
  EXPECT_NE(target.children(), source.children());
  EXPECT_EQ(target.childIndex(0), 5);
  EXPECT_EQ(source.childIndex(0), 5);
  auto& self = target;
  target = self;
  EXPECT_EQ(target.childIndex(0), 5);
  target = OpenTile<T>();
  EXPECT_EQ(target.children(), nullptr);
  EXPECT_FALSE(target.valid());
}

// requirement
TYPED_TEST(TileRecord, InvalidateFreesTheTableAndKeepsTheFields) {
  using T = TypeParam;
  OpenTile<T> t(T::kMinTileCoord, T::kMinTileCoord, T::kMinTileCoord, 2, 6, 1);
  t.invalidate();
  EXPECT_FALSE(t.valid());
  EXPECT_EQ(t.children(), nullptr);
  EXPECT_EQ(t.treeIndex(), (TreeIndex{6, 2}));
  EXPECT_EQ(t.tijk(), (int3{T::kMinTileCoord, T::kMinTileCoord, T::kMinTileCoord}));
  EXPECT_FALSE(t.hasLeaves());
  t.invalidate();
  EXPECT_FALSE(t.valid());
}

// requirement
TYPED_TEST(TileRecord, SettersSetOneField) {
  OpenTile<TypeParam> t(0, 0, 0, 1);
  t.setIndex(17);
  t.setBranchSize(1000);
  EXPECT_EQ(t.index(), 17);
  EXPECT_EQ(t.branchSize(), 1000);
}

// requirement
TYPED_TEST(TileRecord, MemoryCountsTheTableWhenItExists) {
  using T = TypeParam;
  using Storage = TileBinaryNonCompatible<T::kTileSize>;
  std::uint64_t used = 1, allocated = 2;
  OpenTile<T>().memUse(used, allocated);
  EXPECT_EQ(used, sizeof(Storage));
  EXPECT_EQ(allocated, sizeof(Storage));
  OpenTile<T>(0, 0, 0, 1).memUse(used, allocated);
  EXPECT_EQ(used, sizeof(Storage) + T::kTileSize * 8);
  EXPECT_EQ(allocated, used);
}

// requirement: the record is small and adds nothing to its storage
TYPED_TEST(TileRecord, RecordIsSmall) {
  using T = TypeParam;
  EXPECT_EQ(sizeof(Tile<T, T::kTileSize>), sizeof(TileBinaryNonCompatible<T::kTileSize>));
  EXPECT_LE(sizeof(Tile<T, T::kTileSize>), 56u);
}

// requirement
TYPED_TEST(TileRecord, IsOKTestsDepthIndexParentAndCorner) {
  using T = TypeParam;
  auto const tile = [](int depth, std::int64_t index, std::int64_t parent, int3 corner) {
    OpenTile<T> t;
    t.m_depth = depth, t.m_index = index, t.m_parent = parent, t.m_tijk = corner;
    return t.isOK();
  };
  int3 const low{T::kMinTileCoord, T::kMinTileCoord, T::kMinTileCoord};
  int3 const high{T::kMaxTileCoord, T::kMaxTileCoord, T::kMaxTileCoord};
  EXPECT_TRUE(tile(-1, -1, -1, {0, 0, 0}));
  EXPECT_TRUE(tile(0, 0, -1, low));
  EXPECT_TRUE(tile(T::kMaxDepth, 5, 5, high));
  EXPECT_TRUE(tile(3, 0, -1, low)) << "a positive depth with a negative parent passes";
  EXPECT_FALSE(tile(-2, 0, 0, low));
  EXPECT_FALSE(tile(T::kMaxDepth + 1, 0, 0, low));
  EXPECT_FALSE(tile(1, -2, 0, low));
  EXPECT_FALSE(tile(1, 0, -2, low));
  EXPECT_FALSE(tile(0, 0, 0, low)) << "depth 0 has no parent";
  for (int axis = 0; axis < 3; ++axis) {
    int3 corner = low;
    corner[axis] = T::kMinTileCoord - 1;
    EXPECT_FALSE(tile(1, 0, 0, corner)) << axis;
    corner[axis] = T::kMaxTileCoord + 1;
    EXPECT_FALSE(tile(1, 0, 0, corner)) << axis;
  }
}

namespace {

std::vector<std::string> linesOf(std::string const& text) {
  std::vector<std::string> lines;
  std::istringstream in(text);
  for (std::string line; std::getline(in, line);) lines.push_back(line);
  return lines;
}

template <class T> std::vector<std::string> dumpOf(OpenTile<T> const& t) {
  std::ostringstream out;
  t.dump(out);
  return linesOf(out.str());
}

/// The lines of a dump that tell of failed checks.
template <class T> std::vector<std::string> complaintsOf(OpenTile<T> const& t) {
  auto lines = dumpOf(t);
  std::erase_if(lines, [](auto const& line) { return line.find("failed") == std::string::npos; });
  return lines;
}

} // namespace

// requirement
TYPED_TEST(TileRecord, DumpNamesEachFieldBehindTheAddress) {
  using T = TypeParam;
  OpenTile<T> const t(0, 1, 2, 4, 8, 3);
  auto const lines = dumpOf(t);
  ASSERT_EQ(lines.size(), 11u);
  EXPECT_EQ(lines.front(), "================");
  EXPECT_EQ(lines.back(), "================");
  std::ostringstream address, table;
  address << static_cast<void const*>(&t);
  table << static_cast<void const*>(t.children());
  std::vector<std::string> const expected = {" this->m_depth: 4",
                                             " this->m_parent: 3",
                                             " this->m_index: 8",
                                             " this->m_tijk.x: 0",
                                             " this->m_tijk.y: 1",
                                             " this->m_tijk.z: 2",
                                             " this->m_valid: 1",
                                             " this->children() = " + table.str(),
                                             " this->m_branchSize = " + std::to_string(T::kTileSize)};
  for (std::size_t n = 0; n < expected.size(); ++n) EXPECT_EQ(lines[n + 1], address.str() + expected[n]);
}

// requirement
TYPED_TEST(TileRecord, DumpComplainsOfAParentAtDepthZero) {
  using T = TypeParam;
  OpenTile<T> const t(T::kMinTileCoord, T::kMinTileCoord, T::kMinTileCoord, 0, 0, 3);
  EXPECT_FALSE(t.isOK());
  EXPECT_EQ(complaintsOf(t),
            std::vector<std::string>{
                " check !((this->m_depth==0&&this->m_parent<0)||(this->m_depth>0&&this->m_parent>=0)||"
                "this->m_depth==-1) failed"});
}

// requirement: the checks of a dump are looser than those of isOK, and different
TYPED_TEST(TileRecord, DumpChecksDifferFromIsOK) {
  using T = TypeParam;
  OpenTile<T> t;
  t.m_index = -2, t.m_parent = -2;
  EXPECT_FALSE(t.isOK());
  EXPECT_TRUE(complaintsOf(t).empty());
  OpenTile<T> root(0, 0, 0, 2);
  EXPECT_TRUE(root.isOK());
  EXPECT_EQ(complaintsOf(root).size(), 1u) << "a positive depth needs a parent";
}

// requirement
TYPED_TEST(TileRecord, DumpListsAllFailedChecksInOrder) {
  using T = TypeParam;
  OpenTile<T> t;
  t.m_depth = T::kMaxDepth + 1;
  t.m_parent = 1000000001;
  t.m_index = -3;
  t.m_tijk = {T::kMinTileCoord - 1, std::numeric_limits<int>::max(), std::numeric_limits<int>::min()};
  auto const check = [](std::string const& what) { return " check !(" + what + ") failed"; };
  EXPECT_EQ(complaintsOf(t), (std::vector<std::string>{
                                 check("this->m_depth>=-1 && this->m_depth<=kMaxDepth"),
                                 check("this->m_parent>=-2 && this->m_parent<=1000000000"),
                                 check("this->m_index>=-2 && this->m_index<=1000000000"),
                                 check("this->m_tijk.x>=kMinTileCoord && this->m_tijk.x<=kMaxTileCoord"),
                                 check("this->m_tijk.y>=kMinTileCoord && this->m_tijk.y<=kMaxTileCoord"),
                                 check("this->m_tijk.z>=kMinTileCoord && this->m_tijk.z<=kMaxTileCoord")}));
  t.m_depth = -2, t.m_parent = -3, t.m_index = 1000000001;
  EXPECT_EQ(complaintsOf(t).size(), 7u);
}
