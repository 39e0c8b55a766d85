// Walks over all elements, and growth of single tiles.
#include "GeometryVolume/channels/Channel.h"
#include "GeometryVolume/tiletree/Container.h"
#include "support/Shapes.h"

#include <algorithm>

using namespace VLN::TileTree3D;

namespace {

template <class TraitsT> class ElementWalk : public ::testing::Test {
public:
  using T = TraitsT;
  using Points = Channel<T, int, T::kTileDataWidth, 0>;
  using Voxels = Channel<T, int, T::kTileDataWidth, 1>;

  Container<T> tree;
  Points points{"points", nullptr, kInitializeDefaultValue, false, true, 0, 28};

  /// Tiles at depths 2, 5 and the deepest; the depths between stay empty.
  void addTiles(int each) {
    auto accessor = tree.tileAccessor();
    int row = T::kMinTileCoord;
    for (int d : {2, 5, T::kMaxDepth}) {
      for (int n = 0; n < each; ++n) accessor.addTile(T::kMinTileCoord + n * T::width(d), row, 0, d);
      row += T::width(2);
    }
    points.enableAllocateEmptyTileData();
    points.update(tree);
  }
  void put(TreeIndex const& at, std::vector<int> const& values) {
    auto data = points.tileDataAccessor().tileData(at);
    for (int const v : values) data.push(v);
  }
  std::vector<int> walk() const { return {points.cbegin(), points.cend()}; }
};
TYPED_TEST_SUITE(ElementWalk, Support::Shapes, Support::ShapeNames);

TYPED_TEST(ElementWalk, AnEmptyChannelBeginsAtItsEnd) {
  EXPECT_EQ(this->points.begin(), this->points.end());
  EXPECT_EQ(this->points.cbegin(), this->points.cend());
  EXPECT_FALSE(this->points.cbegin().treeIndex().valid());
  this->addTiles(3); // tiles without elements
  EXPECT_EQ(this->points.begin(), this->points.end());
}

TYPED_TEST(ElementWalk, EmptyTilesAndDepthsAreNotSeen) {
  this->addTiles(3);
  int const deep = TypeParam::kMaxDepth;
  int const first = static_cast<int>(this->tree.tileCount(deep));
  ASSERT_GE(first, 3);
  this->put({0, deep}, {1, 2});
  this->put({2, deep}, {3}); // tile 1 between stays empty
  EXPECT_EQ(this->walk(), (std::vector<int>{1, 2, 3}));
  this->put({1, 2}, {-1});
  EXPECT_EQ(this->walk(), (std::vector<int>{-1, 1, 2, 3})) << "depth by depth";
  this->put({2, 5}, {7, 8, 9});
  EXPECT_EQ(this->walk(), (std::vector<int>{-1, 7, 8, 9, 1, 2, 3}));

  auto it = this->points.cbegin();
  EXPECT_EQ(it.treeIndex(), (TreeIndex{1, 2}));
  it++, ++it;
  EXPECT_EQ(it.elementTreeIndex(), ElementTreeIndex(TreeIndex{2, 5}, 1));
  EXPECT_EQ(this->points[it.elementTreeIndex()], 8);
  EXPECT_NE(it, this->points.cbegin());
}

TYPED_TEST(ElementWalk, ElementsCanBeWritten) {
  this->addTiles(2);
  this->put({0, 5}, {1, 2});
  this->put({1, TypeParam::kMaxDepth}, {3});
  for (int& v : this->points) v *= 10;
  EXPECT_EQ(this->walk(), (std::vector<int>{10, 20, 30}));
  *this->points.begin().operator->() = 5;
  EXPECT_EQ(this->walk(), (std::vector<int>{5, 20, 30}));
}

TYPED_TEST(ElementWalk, StepsOfManyCountWholeTiles) {
  this->addTiles(3);
  typename TestFixture::Voxels voxels("voxels", nullptr, kInitializeDefaultValue, false, true, 0, 28);
  voxels.update(this->tree);
  int value = 0;
  for (int& v : voxels) v = value++;
  std::int64_t const size = TestFixture::Voxels::kSize;
  ASSERT_EQ(value, voxels.tileCount(-1) * size);
  for (std::int64_t const n : {std::int64_t(0), std::int64_t(1), size - 1, size, size + 1, 3 * size,
                               4 * size + 7, std::int64_t(value) - 1}) {
    auto it = voxels.cbegin();
    it += n;
    EXPECT_EQ(*it, n);
    it += -n;
    EXPECT_EQ(it, voxels.cbegin());
    auto back = voxels.cend();
    back += n - value;
    EXPECT_EQ(*back, n);
  }
  auto it = voxels.cbegin();
  it += value;
  EXPECT_EQ(it, voxels.cend());
  it += 0;
  EXPECT_EQ(it, voxels.cend());
  auto one = voxels.cbegin();
  one += size - 1;
  EXPECT_EQ(*++one, size) << "a single step leaves the tile";
}

TYPED_TEST(ElementWalk, OneTileGrowsByTheAccessor) {
  this->addTiles(2);
  auto accessor = this->points.tileDataAccessor();
  auto moved = std::move(accessor);
  std::int64_t flat = 0;
  for (int d = 0; d < TypeParam::kMaxDepth; ++d) flat += this->tree.tileCount(d);
  moved.tileData(flat).push(4); // the first tile of the deepest depth
  auto data = moved.tileData(TreeIndex{0, TypeParam::kMaxDepth});
  EXPECT_EQ(data.size(), 1);
  data.resize(3, 9);
  EXPECT_EQ(this->walk(), (std::vector<int>{4, 9, 9}));
  data.pop();
  EXPECT_EQ(data.back(), 9);
  data.clear();
  EXPECT_TRUE(this->walk().empty());
  EXPECT_EQ(this->points.elementCount(-1), 0);
}

TYPED_TEST(ElementWalk, JoinKeepsTheOrder) {
  TileDataElementAccessor a, b;
  a.move(ElementTreeIndex(TreeIndex{1, 5}, 2), {3, 4});
  b.move(ElementTreeIndex(TreeIndex{6, 5}, 0), {9, 4});
  b.remove(ElementTreeIndex(TreeIndex{7, 5}, 1));
  a.join(b);
  ASSERT_EQ(a.elementsTo().size(), 29u);
  ASSERT_EQ(a.elementsFrom().size(), 29u);
  EXPECT_EQ(a.elementsTo()[4], (std::vector<ElementToFrom>{{3, 1, 2, 5}, {9, 6, 0, 5}}));
  EXPECT_EQ(a.elementsFrom()[5], (std::vector<ElementInTile>{{1, 2}, {6, 0}, {7, 1}}));
}

TYPED_TEST(ElementWalk, RemovingAloneShrinksTheTile) {
  this->addTiles(1);
  TreeIndex const at{0, TypeParam::kMaxDepth};
  this->put(at, {1, 2, 3});
  TileDataElementAccessor accessor;
  accessor.remove(ElementTreeIndex(at, 0));
  for (auto const& list : accessor.elementsTo()) EXPECT_TRUE(list.empty());
  this->points.update(accessor);
  EXPECT_EQ(this->walk(), (std::vector<int>{3, 2}));
}

TYPED_TEST(ElementWalk, RecordsOfAnySizeApplyAlike) {
  // 499 and 500 records: serial and parallel sorts.
  for (int const records : {1, 499, 500, 501, 5000}) {
    Container<TypeParam> row;
    auto tiles = row.tileAccessor();
    int const deep = TypeParam::kMaxDepth;
    for (int n = 0; n < 40; ++n) tiles.addTile(1000 + n * TypeParam::width(deep), 0, 0, deep);
    typename TestFixture::Points channel("p", nullptr, kInitializeDefaultValue, false, true, 0, 28);
    channel.enableAllocateEmptyTileData();
    channel.update(row);
    auto data = channel.tileDataAccessor().tileData(TreeIndex{0, deep});
    for (int n = 0; n < records; ++n) data.push(n);
    TileDataElementAccessor accessor;
    for (int n = records - 1; n >= 0; --n)
      accessor.move(ElementTreeIndex(TreeIndex{0, deep}, n), {1 + n % 39, deep});
    channel.update(accessor);
    EXPECT_EQ(channel.elementCount(TreeIndex{0, deep}), 0);
    std::vector<int> all(channel.cbegin(), channel.cend());
    for (auto it = channel.cbegin(); it != channel.cend(); ++it)
      ASSERT_EQ(1 + *it % 39, it.treeIndex().index);
    std::sort(all.begin(), all.end());
    ASSERT_EQ(static_cast<int>(all.size()), records);
    for (int n = 0; n < records; ++n) ASSERT_EQ(all[static_cast<std::size_t>(n)], n);
  }
}

} // namespace
