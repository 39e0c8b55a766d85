// Numbers of the two tree shapes: constants, widths, alignment, small address types.
#include "GeometryVolume/tiletree/Container.h"
#include "support/Print.h"
#include "support/Shapes.h"

#include <gtest/gtest.h>

#include <limits>
#include <random>

using namespace VLN::TileTree3D;

VLN_SHAPE_SUITE(Shape);

// requirement
TEST(ShapeConstants, PowerOfTwo) {
  using C = Container<PowerOfTwoTraits>;
  EXPECT_EQ(C::kTW, 2);
  EXPECT_EQ(C::kTileWidth, 2);
  EXPECT_EQ(C::kTDW, 4);
  EXPECT_EQ(C::kTileSize, 8);
  EXPECT_EQ(C::kMaxDepth, 28);
  EXPECT_EQ(C::kMaxParallelDepth, 26);
  EXPECT_EQ(C::kDepthFirstMaxParallelDepth, 25);
  EXPECT_EQ(C::kMinTileCoord, -536870912);
  EXPECT_EQ(C::kMaxTileCoord, 536870911);
  EXPECT_EQ(std::int64_t(C::kMaxTileCoord) - C::kMinTileCoord + 1, std::int64_t(1) << 30);
  EXPECT_EQ(C::TileType::tileDataSize(), 64);
}

// requirement
TEST(ShapeConstants, Odd) {
  using C = Container<OddTraits>;
  EXPECT_EQ(C::kTW, 5);
  EXPECT_EQ(C::kTileWidth, 5);
  EXPECT_EQ(C::kTDW, 5);
  EXPECT_EQ(C::kTileSize, 125);
  EXPECT_EQ(C::kMaxDepth, 12);
  EXPECT_EQ(C::kMaxParallelDepth, 10);
  EXPECT_EQ(C::kDepthFirstMaxParallelDepth, 9);
  EXPECT_EQ(C::kMinTileCoord, -610351562);
  EXPECT_EQ(C::kMaxTileCoord, 610351562);
  EXPECT_EQ(std::int64_t(C::kMaxTileCoord) - C::kMinTileCoord + 1, 1220703125);
  EXPECT_EQ(C::TileType::tileDataSize(), 125);
}

// requirement
TYPED_TEST(Shape, WidthsDivideByTheTileWidthAtEachDepth) {
  using T = TypeParam;
  using TileT = typename Container<T>::TileType;
  std::int64_t w = T::kTW == 2 ? std::int64_t(1) << 30 : 1220703125;
  for (int d = 0; d <= T::kMaxDepth; ++d, w /= T::kTW) {
    SCOPED_TRACE(d);
    EXPECT_EQ(TileT::tileVoxelWidth(d), w);
    EXPECT_EQ(TileT::voxelWidth(d), w / T::kTW);
    EXPECT_EQ(TileT::voxelDataWidth(d), w / T::kTDW);
    EXPECT_EQ(w % T::kTDW, 0) << "sample widths are whole";
    EXPECT_EQ(Container<T>::tileVoxelWidth(d), w);
    EXPECT_EQ(Container<T>::voxelWidth(d), w / T::kTW);
    EXPECT_EQ(Container<T>::voxelDataWidth(d), w / T::kTDW);
    if (d < T::kMaxDepth) {
      EXPECT_EQ(TileT::childTileVoxelWidth(d), w / T::kTW);
      EXPECT_EQ(TileT::childVoxelWidth(d), w / T::kTW / T::kTW);
      EXPECT_EQ(TileT::childVoxelDataWidth(d), w / T::kTW / T::kTDW);
    }
    if (d > 0) {
      EXPECT_EQ(TileT::parentTileVoxelWidth(d), w * T::kTW);
      EXPECT_EQ(TileT::parentVoxelWidth(d), w);
      EXPECT_EQ(TileT::parentVoxelDataWidth(d), w * T::kTW / T::kTDW);
    }
  }
  EXPECT_EQ(TileT::tileVoxelWidth(T::kMaxDepth), T::kTDW);
  EXPECT_EQ(TileT::voxelDataWidth(T::kMaxDepth), 1);
  EXPECT_EQ(TileT::tileVoxelWidth(T::kMaxDepth + 1), T::kTDW / T::kTW);
  EXPECT_EQ(TileT::tileWidth(), T::kTW);
  EXPECT_EQ(TileT::tileSize(), T::kTileSize);
  EXPECT_EQ(TileT::tileDataWidth(), T::kTDW);
}

// boundary: relatives of the first and the last depth read beyond the depths, and divide by what they read
TYPED_TEST(Shape, WidthsBeyondTheDepthsArePositive) {
  using T = TypeParam;
  using TileT = typename Container<T>::TileType;
  EXPECT_GT(TileT::parentTileVoxelWidth(0), 0);
  EXPECT_GT(TileT::parentVoxelWidth(0), 0);
  EXPECT_GT(TileT::childTileVoxelWidth(T::kMaxDepth), 0);
  EXPECT_GT(TileT::childVoxelWidth(T::kMaxDepth), 0);
  EXPECT_GT(TileT::voxelWidth(T::kMaxDepth), 0);
}

// requirement: u = c - min, aligned = u - u mod W + min
TYPED_TEST(Shape, AlignmentFollowsItsFormula) {
  using T = TypeParam;
  std::uint32_t const seed = 20240601;
  std::mt19937 random(seed);
  std::uniform_int_distribution<int> any(T::kMinTileCoord, T::kMaxTileCoord);
  auto const expected = [](std::int64_t c, int d) {
    std::int64_t const u = c - T::kMinTileCoord;
    return u - u % T::width(d) + T::kMinTileCoord;
  };
  for (int d = 0; d <= T::kMaxDepth; ++d) {
    for (int c : {T::kMinTileCoord, T::kMinTileCoord + 1, -1, 0, 1, T::kMaxTileCoord - 1, T::kMaxTileCoord})
      ASSERT_EQ(T::align(c, d), expected(c, d)) << c << " at depth " << d;
    for (int n = 0; n < 500; ++n) {
      // Near multiples of the width as well: there a reciprocal that is off by one shows.
      int c = any(random);
      if (n % 2) {
        std::int64_t const edge = expected(c, d) + n % 3 - 1;
        if (edge < T::kMinTileCoord || edge > T::kMaxTileCoord) continue;
        c = static_cast<int>(edge);
      }
      ASSERT_EQ(T::align(c, d), expected(c, d)) << c << " at depth " << d << ", seed " << seed;
    }
  }
}

// boundary
TYPED_TEST(Shape, TheLowEndAlignsToItselfAndTheHighEndIsInside) {
  using T = TypeParam;
  for (int d = 0; d <= T::kMaxDepth; ++d) {
    EXPECT_EQ(T::align(T::kMinTileCoord, d), T::kMinTileCoord) << d;
    EXPECT_EQ(std::int64_t(T::align(T::kMaxTileCoord, d)) + T::width(d), std::int64_t(T::kMaxTileCoord) + 1);
  }
  EXPECT_TRUE(T::inDomain(T::kMinTileCoord));
  EXPECT_TRUE(T::inDomain(T::kMaxTileCoord));
  EXPECT_FALSE(T::inDomain(T::kMinTileCoord - 1));
  EXPECT_FALSE(T::inDomain(T::kMaxTileCoord + 1));
  EXPECT_FALSE(T::inDomain(std::numeric_limits<int>::min()));
  EXPECT_FALSE(T::inDomain(std::numeric_limits<int>::max()));
}

// boundary
TEST(OddShape, DeepestCornersCountInFivesFromTheLowEnd) {
  for (int n : {0, 1, 2, 122070312, 244140624}) {
    int const corner = -610351562 + 5 * n;
    for (int inside = 0; inside < 5; ++inside)
      EXPECT_EQ(OddTraits::align(corner + inside, 12), corner) << n << " + " << inside;
  }
  EXPECT_EQ(OddTraits::align(610351562, 12), 610351558);
}

// requirement
TEST(Addresses, DefaultsAreInvalid) {
  EXPECT_EQ(TreeIndex{}.index, -1);
  EXPECT_EQ(TreeIndex{}.depth, -1);
  EXPECT_FALSE(TreeIndex{}.valid());
  VoxelCoord const c;
  EXPECT_EQ(c.ijk(), (int3{0, 0, 0}));
  EXPECT_EQ(c.depth, -1);
  VoxelTreeIndex const v;
  EXPECT_EQ(v.index, -1);
  EXPECT_EQ(v.depth, -1);
  EXPECT_EQ(v.ijk, (int3{0, 0, 0}));
  EXPECT_EQ((VoxelTreeIndex({3, 2}, {1, 0, 1})), (VoxelTreeIndex(3, 2, {1, 0, 1})));
  EXPECT_FALSE((VoxelTreeIndex({3, 2}, {1, 0, 1})) == (VoxelTreeIndex(3, 2, {1, 1, 1})));
  EXPECT_FALSE((VoxelTreeIndex({3, 2}, {1, 0, 1})) == (VoxelTreeIndex(3, 1, {1, 0, 1})));
}

// requirement
TEST(Addresses, TreeIndicesOrderByDepthThenIndex) {
  EXPECT_LT((TreeIndex{9, 1}), (TreeIndex{0, 2}));
  EXPECT_LT((TreeIndex{0, 2}), (TreeIndex{1, 2}));
  EXPECT_FALSE((TreeIndex{1, 2}) < (TreeIndex{1, 2}));
}

// requirement
TEST(Addresses, NeighborDirectionsCountInNinesThreesAndOnes) {
  int n = 0;
  for (int di = -1; di <= 1; ++di) {
    for (int dj = -1; dj <= 1; ++dj) {
      for (int dk = -1; dk <= 1; ++dk, ++n) {
        EXPECT_EQ(neighborDirection(di, dj, dk), n);
        EXPECT_EQ(neighborOffset(n), (int3{di, dj, dk})) << n;
      }
    }
  }
  EXPECT_EQ(n, kNeighborCount);
  EXPECT_EQ(neighborOffset(0), (int3{-1, -1, -1}));
  EXPECT_EQ(neighborOffset(kNeighborSelf), (int3{0, 0, 0}));
  EXPECT_EQ(neighborOffset(26), (int3{1, 1, 1}));
}
