// Self-checks and dumps of a container: what they accept, what they refuse, and the words they use.
#include "support/CaptureStream.h"
#include "support/ContainerAccess.h"
#include "support/Print.h"
#include "support/Shapes.h"

#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/core/Streaming.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <functional>
#include <sstream>
#include <string>
#include <vector>

using namespace VLN::TileTree3D;
using Support::Access;
using Support::CaptureStream;
using ::testing::EndsWith;
using ::testing::HasSubstr;
using ::testing::Not;

VLN_SHAPE_SUITE(Consistency);

namespace {

/// Root at depth 2, a child at 3, two grandchildren at 4, and a root of its own at depth 4.
template <class T> Container<T> sample() {
  Container<T> tree("sample", 1.0f);
  Access::addTile(tree, {0, 0, 0}, 2);
  Access::addTile(tree, {0, 0, 0}, 4);
  int3 const p = tree.tile(0, 4).tijk();
  int3 const parent = tree.tile(0, 3).tijk();
  int const beside = p.x + T::width(4) < parent.x + T::width(3) ? T::width(4) : -T::width(4);
  Access::addTile(tree, {p.x + beside, p.y, p.z}, 4);
  Access::addTile(tree, {T::kMaxTileCoord, T::kMaxTileCoord, T::kMaxTileCoord}, 4);
  Access::setBranchSizes(tree);
  return tree;
}

/// What the verbose check writes; the quiet one must agree and stay silent.
template <class T> std::string refusal(Container<T> const& tree) {
  CaptureStream const quiet;
  EXPECT_FALSE(tree.checkConsistency(false));
  EXPECT_EQ(quiet.text(), "");
  CaptureStream const err;
  EXPECT_FALSE(tree.checkConsistency(true));
  return err.text();
}

template <class T> std::string branchRefusal(Container<T> const& tree) {
  CaptureStream const quiet;
  EXPECT_FALSE(tree.checkBranchSizes(false));
  EXPECT_EQ(quiet.text(), "");
  CaptureStream const err;
  EXPECT_FALSE(tree.checkBranchSizes(true));
  return err.text();
}

} // namespace

// boundary
TYPED_TEST(Consistency, EmptyContainerPassesBothChecks) {
  Container<TypeParam> const tree;
  EXPECT_TRUE(tree.checkConsistency(false));
  EXPECT_TRUE(tree.checkBranchSizes(false));
  CaptureStream const err;
  EXPECT_TRUE(tree.checkConsistency(true));
  EXPECT_THAT(err.text(), EndsWith("Consistency OK!\n"));
  EXPECT_TRUE(tree.checkBranchSizes(true));
  EXPECT_THAT(err.text(), EndsWith("BranchSizes OK!\n"));
}

// requirement: the verbose form dumps first and lists the counts
TYPED_TEST(Consistency, VerboseSuccessDumpsCountsAndSaysSo) {
  auto const tree = sample<TypeParam>();
  std::ostringstream dump;
  tree.dump(dump);
  CaptureStream const err;
  EXPECT_TRUE(tree.checkConsistency(true));
  std::string const text = err.text();
  EXPECT_EQ(text.substr(0, dump.str().size()), dump.str());
  for (int d = 0; d <= TypeParam::kMaxDepth; ++d)
    EXPECT_THAT(text,
                HasSubstr("tileCount[" + std::to_string(d) + "] = " + std::to_string(tree.tileCount(d))));
  EXPECT_THAT(text, EndsWith("Consistency OK!\n"));
}

// negative
TYPED_TEST(Consistency, RefusesTilesWithoutRoots) {
  Container<TypeParam> tree;
  Access::allocateTiles(tree, 3, 2);
  EXPECT_THAT(refusal(tree), EndsWith("rootCount()==0 and tileCount()==2\n"));
}

// negative
TYPED_TEST(Consistency, RefusesATotalThatIsNotTheSum) {
  auto tree = sample<TypeParam>();
  Access::resize(tree, 4, 7);
  EXPECT_THAT(refusal(tree), EndsWith("tileCount != m_data->m_tileCountTotal: 9 5\n"));
}

// negative
TYPED_TEST(Consistency, RefusesDeadTiles) {
  auto tree = sample<TypeParam>();
  Access::allocateTile(tree, 7);
  EXPECT_THAT(refusal(tree), EndsWith("tile 7 0 not valid!\n"));
}

// negative: the tile's own dump follows
TYPED_TEST(Consistency, RefusesTilesThatAreNotOK) {
  auto tree = sample<TypeParam>();
  Access::editTile(tree, {1, 4}).setIndex(-2);
  std::ostringstream dump;
  tree.tile(1, 4).dump(dump);
  EXPECT_THAT(refusal(tree), EndsWith("tile not ok: " + dump.str()));
}

// negative
TYPED_TEST(Consistency, RefusesAMissingChild) {
  auto tree = sample<TypeParam>();
  auto& parent = Access::editTile(tree, {0, 3});
  parent.childIndex(*parent.begin()) = -1;
  EXPECT_THAT(refusal(tree), EndsWith("numChildren != m_data->m_tileCountTotal-m_roots.size(): 2 != 3\n"));
}

// negative: each child must know its parent, and sit in its own slot
TYPED_TEST(Consistency, RefusesCrossedLinks) {
  auto tree = sample<TypeParam>();
  auto& parent = Access::editTile(tree, {0, 3});
  std::swap(parent.childIndex(*parent.begin()), parent.childIndex(*parent.rbegin()));
  EXPECT_THAT(refusal(tree), Not(HasSubstr("Consistency OK!")));
  auto other = sample<TypeParam>();
  auto& second = Access::editTile(other, {0, 3});
  second.childIndex(*second.begin()) = 1 << 20;
  EXPECT_THAT(refusal(other), Not(HasSubstr("Consistency OK!")));
}

// negative: counts agree, yet a walk from the roots meets another number of tiles
TYPED_TEST(Consistency, RefusesTilesThatNoRootReaches) {
  auto tree = sample<TypeParam>();
  Access::removeRoot(tree, {2, 4});
  Access::addRoot(tree, {0, 3});
  EXPECT_THAT(refusal(tree), EndsWith("visitor.m_numTiles != m_numTilesTotal: 7 5\n"));
}

// negative: every wrong size is told, also below a wrong child
TYPED_TEST(Consistency, BranchSizeMismatchesAreAllTold) {
  using T = TypeParam;
  auto tree = sample<T>();
  EXPECT_TRUE(tree.checkBranchSizes(false));
  Access::editTile(tree, {0, 4}).setBranchSize(1);
  Access::editTile(tree, {1, 4}).setBranchSize(2);
  Access::editTile(tree, {0, 2}).setBranchSize(3);
  std::string const text = branchRefusal(tree);
  auto const line = [](int index, int depth, int stored, int computed) {
    return "Branch size mismatch at tile = " + std::to_string(index) + " " + std::to_string(depth) +
           ": branchSize=" + std::to_string(stored) + ", computed = " + std::to_string(computed) + "\n";
  };
  EXPECT_THAT(text, HasSubstr(line(0, 4, 1, T::kTileSize)));
  EXPECT_THAT(text, HasSubstr(line(1, 4, 2, T::kTileSize)));
  EXPECT_THAT(text, HasSubstr(line(0, 2, 3, 4 * T::kTileSize)));
  EXPECT_THAT(text, EndsWith("checkBranchSizes not ok: tileCount = 5\n"));
  Access::setBranchSizes(tree);
  EXPECT_TRUE(tree.checkBranchSizes(false));
}

// boundary
TYPED_TEST(Consistency, SingleAdditionUnderAnOldRootNeedsTheBulkPass) {
  auto tree = sample<TypeParam>();
  int3 const corner = tree.tile(0, 4).tijk();
  Access::addTile(tree, corner, 6);
  EXPECT_TRUE(tree.checkConsistency(false));
  EXPECT_FALSE(tree.checkBranchSizes(false));
  Access::setBranchSizes(tree);
  EXPECT_TRUE(tree.checkBranchSizes(false));
}

// requirement: the branch sizes are the same at any number of threads
TYPED_TEST(Consistency, BranchSizesDoNotDependOnThreads) {
  using T = TypeParam;
  Container<T> tree;
  auto accessor = tree.tileAccessor();
  accessor.addTiles({0, 0, 0}, {80, 80, 80}, T::kMaxDepth);
  accessor.addTile(0, 0, 0, 1);
  for (int threads : {1, 2, 8}) {
    VLN::withThreads(threads, [&] { Access::setBranchSizes(tree); });
    EXPECT_TRUE(tree.checkBranchSizes(false)) << threads;
    for (auto t = tree.beginTiles(); t != tree.endTiles(); ++t) t->setBranchSize(-1);
  }
}

// requirement: sizes that somebody has changed as well
TYPED_TEST(Consistency, ManyTilesAtOnceMakeAllBranchSizesRight) {
  using T = TypeParam;
  Container<T> tree;
  auto accessor = tree.tileAccessor();
  accessor.addTiles({0, 0, 0}, {20, 20, 20}, T::kMaxDepth);
  for (auto t = tree.beginTiles(); t != tree.endTiles(); ++t) t->setBranchSize(-1);
  typename Container<T>::TileLists lists;
  for (int n = 0; n < 50; ++n) lists[T::kMaxDepth].append({n, n, 0});
  accessor.addTiles(lists);
  EXPECT_TRUE(tree.checkBranchSizes(true));
}

// requirement
TYPED_TEST(Consistency, DumpListsCountsRootsAndTiles) {
  using T = TypeParam;
  Container<T> tree("named", 1.0f);
  Access::addTile(tree, {T::kMinTileCoord, T::kMinTileCoord, T::kMinTileCoord}, T::kMaxDepth - 1);
  Access::addTile(tree, {T::kMinTileCoord, T::kMinTileCoord, T::kMinTileCoord}, T::kMaxDepth);
  std::ostringstream os;
  tree.dump(os);
  std::string const text = os.str();
  EXPECT_EQ(text.find("name = named\n\nsize = " + std::to_string(2 * T::kTileSize) + "\naddress = "), 0u)
      << text;
  std::string const low = std::to_string(T::kMinTileCoord);
  std::string const corner = "] = {tijk = " + low + " " + low + " " + low + ", width = ";
  EXPECT_THAT(text, HasSubstr("tileCount {\n0: 0\n1: 0\n"));
  EXPECT_THAT(text, HasSubstr(std::to_string(T::kMaxDepth - 1) + ": 1\n"));
  EXPECT_THAT(text, HasSubstr("roots size {"));
  std::string const upper =
      corner + std::to_string(T::width(T::kMaxDepth - 1)) + ", parent = -1, children = { 0 -1 ";
  EXPECT_THAT(text, HasSubstr("root[" + std::to_string(T::kMaxDepth - 1) + ", 0" + upper));
  EXPECT_THAT(text, HasSubstr("tile[" + std::to_string(T::kMaxDepth - 1) + ", 0" + upper));
  EXPECT_THAT(text, HasSubstr("tile[" + std::to_string(T::kMaxDepth) + ", 0" + corner +
                              std::to_string(T::width(T::kMaxDepth)) + ", parent = 0, children = nullptr"));
}

// requirement
TYPED_TEST(Consistency, DumpSkipsDeadTilesAndFollowsThePad) {
  using T = TypeParam;
  Container<T> tree;
  TreeIndex const a = Access::addTile(tree, {0, 0, 0}, 4);
  TreeIndex const b = Access::addTile(tree, {T::width(4), 0, 0}, 4);
  std::ostringstream before;
  VLN::Streaming::setPadWidth(before, 3);
  VLN::Streaming::incIndent(before, 1);
  tree.dump(before);
  EXPECT_THAT(before.str(), HasSubstr("\n   tileCount {\n"));
  EXPECT_THAT(before.str(), HasSubstr("   tile[4, 0]"));
  EXPECT_THAT(before.str(), HasSubstr("   tile[4, 1]"));
  Access::killLeafTile(tree, a);
  std::ostringstream after;
  tree.dump(after);
  EXPECT_THAT(after.str(), Not(HasSubstr("tile[4, " + std::to_string(a.index) + "]")));
  EXPECT_THAT(after.str(), HasSubstr("tile[4, " + std::to_string(b.index) + "]"));
}
