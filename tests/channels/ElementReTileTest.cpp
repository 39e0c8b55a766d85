// Points that move from tile to tile, with everything that follows them.
#include "support/PointCloud.h"
#include "support/Shapes.h"

#include "GeometryVolume/core/Parallel.h"
#include <limits>

using namespace Support;
using namespace VLN::TileTree3D;

namespace {

template <class TraitsT> class ReTile : public ::testing::Test {
public:
  using T = TraitsT;
  using M = TreeModel<T>;
  using Cloud = PointCloud<T>;

  static VoxelCoord deepest(int i, int j, int k) { return M::holder({i, j, k}, T::kMaxDepth); }
  /// Tiles of mixed depths in a few clusters, most of them with points.
  static void fill(Cloud& cloud, std::uint32_t seed, int tiles) {
    TilePlaces<T> places(seed);
    cloud.addTiles(places.some(tiles));
    for (VoxelCoord const& at : cloud.model.tiles()) {
      for (int n = places.below(4) * places.below(6); n > 0; --n)
        cloud.addPoint(at, Cloud::placeIn(at, cloud.tree.voxelSize(), places.random()));
    }
    cloud.counted();
  }
};
TYPED_TEST_SUITE(ReTile, Shapes, ShapeNames);

TYPED_TEST(ReTile, NothingChangesWhereNoPointLeftItsTile) {
  for (float const voxelSize : {1.0f, 0.5f}) {
    PointCloud<TypeParam> cloud(voxelSize);
    TilePlaces<TypeParam> places(1);
    VoxelCoord const at = this->deepest(7, -3, 12);
    cloud.addTiles({at, this->deepest(100, 0, 0)});
    for (int n = 0; n < 20; ++n) cloud.addPoint(at, cloud.placeIn(at, voxelSize, places.random()));
    cloud.counted();
    auto const before = cloud.contents();
    cloud.reTile(false);
    cloud.check();
    EXPECT_EQ(cloud.contents(), before);
  }
}

TYPED_TEST(ReTile, AnObjectWithoutPointsIsLeftAlone) {
  PointCloud<TypeParam> cloud(1.0f);
  cloud.reTile(true);
  cloud.check();
  cloud.addTiles({this->deepest(0, 0, 0)});
  cloud.reTile(false);
  cloud.check();
  EXPECT_EQ(cloud.tree.tileCount(-1), 1);
  cloud.reTile(true);
  cloud.check();
  EXPECT_EQ(cloud.tree.tileCount(-1), 0);
}

TYPED_TEST(ReTile, NegativePositionsRoundDown) {
  PointCloud<TypeParam> cloud(1.0f);
  // A border of tiles at or below 0, where truncation would round up: 0 in one shape, -2 in the other.
  VoxelCoord const home = this->deepest(100, 100, 100), above = this->deepest(0, 0, 0);
  VoxelCoord const below = this->deepest(above.i - 1, above.j - 1, above.k - 1);
  ASSERT_LE(above.i, 0);
  cloud.addTiles({home, below, above});
  auto const corner = static_cast<float>(above.i);
  cloud.addPoint(home, {corner - 0.5f, corner - 0.5f, corner - 0.5f});
  cloud.addPoint(home, {corner + 0.5f, corner + 0.5f, corner + 0.5f});
  cloud.counted();
  cloud.reTile(false);
  cloud.check();
  EXPECT_EQ(cloud.points[below].size(), 1u);
  EXPECT_EQ(cloud.points[above].size(), 1u);
  EXPECT_EQ(cloud.pointCount(), 2u);
}

TYPED_TEST(ReTile, ANewTileBringsTheWholeChainUpToDepthZero) {
  PointCloud<TypeParam> cloud(1.0f);
  VoxelCoord const home = this->deepest(0, 0, 0);
  cloud.addTiles({home});
  cloud.addPoint(home, {1000.25f, 0, 0});
  cloud.counted();
  cloud.reTile(false);
  cloud.check();
  EXPECT_EQ(cloud.pointCount(), 1u);
  EXPECT_EQ(cloud.tree.rootCount(), 1);
  EXPECT_EQ(cloud.tree.rootCount(0), 1);
}

TYPED_TEST(ReTile, PointsOutOfReachAreDropped) {
  constexpr float kReach = 536870912.0f, kInf = std::numeric_limits<float>::infinity(),
                  kNan = std::numeric_limits<float>::quiet_NaN();
  float const inside = std::nextafter(kReach, 0.0f);
  for (float const voxelSize : {1.0f, 0.5f}) {
    PointCloud<TypeParam> cloud(voxelSize);
    VoxelCoord const home = this->deepest(0, 0, 0);
    VoxelCoord const end = this->deepest(536870880, 0, 0), start = this->deepest(-536870880, 0, 0);
    cloud.addTiles({home, end, start});
    for (float const bad : {kReach, -kReach, kInf, -kInf, kNan, 3e38f}) {
      for (int a = 0; a < 3; ++a) {
        float3 p{0, 0, 0};
        p[a] = bad * voxelSize;
        cloud.addPoint(home, p);
      }
    }
    cloud.addPoint(home, {inside * voxelSize, 0, 0});
    cloud.addPoint(home, {-inside * voxelSize, 0, 0});
    cloud.addPoint(home, {0.5f, 0.5f, 0.5f});
    cloud.counted();
    cloud.reTile(false);
    cloud.check();
    EXPECT_EQ(cloud.pointCount(), 3u);
    EXPECT_EQ(cloud.points[end].size(), 1u);
    EXPECT_EQ(cloud.points[start].size(), 1u);
  }
}

// The scan takes points by fours and in blocks of 64: whichever leaves, it alone moves.
TYPED_TEST(ReTile, AnyPointOfATileMayLeave) {
  VoxelCoord const home = this->deepest(0, 0, 0), next = this->deepest(40, 0, 0);
  for (int const count : {1, 2, 3, 4, 5, 7, 8, 63, 64, 65, 68, 130}) {
    int const step = count < 10 ? 1 : 5;
    for (int leaving = 0; leaving < count; leaving += step) {
      SCOPED_TRACE(std::to_string(leaving) + " of " + std::to_string(count));
      PointCloud<TypeParam> cloud(1.0f);
      cloud.addTiles({home, next});
      for (int n = 0; n < count; ++n) {
        float3 p{0.25f, 0.5f, 0.75f};
        if (n == leaving) p[n % 3] = n % 3 == 0 ? 40.5f : -30.5f;
        cloud.addPoint(home, p);
      }
      cloud.counted();
      cloud.reTile(false);
      cloud.check();
      ASSERT_EQ(cloud.points[home].size(), static_cast<std::size_t>(count - 1));
      ASSERT_FALSE(this->HasFailure());
    }
  }
}

// Far out, corners of tiles lie between floats.
TYPED_TEST(ReTile, BordersHoldWhereFloatsAreCoarse) {
  for (int const far : {1 << 23, 1 << 24, (1 << 24) + 3, 1 << 27, (1 << 29) - 256}) {
    for (int const sign : {-1, 1}) {
      SCOPED_TRACE(sign * far);
      PointCloud<TypeParam> cloud(1.0f);
      VoxelCoord const home = this->deepest(sign * far, 5, -5);
      std::vector<VoxelCoord> tiles{home};
      int const width = TestFixture::M::width(home.depth);
      for (int n = 1; n <= 24; ++n)
        for (int const way : {-1, 1}) tiles.push_back(this->deepest(home.i + way * n * width, 5, -5));
      cloud.addTiles(tiles);
      auto at = static_cast<float>(home.i);
      for (int n = 0; n < 6; ++n) at = std::nextafter(at, -1e30f);
      for (int n = 0; n < 14; ++n, at = std::nextafter(at, 1e30f)) cloud.addPoint(home, {at, 5.5f, -4.5f});
      cloud.counted();
      cloud.reTile(false);
      cloud.check();
      ASSERT_FALSE(this->HasFailure());
    }
  }
}

TYPED_TEST(ReTile, PruningKeepsTheAncestorsOfPoints) {
  PointCloud<TypeParam> cloud(1.0f);
  std::vector<VoxelCoord> tiles;
  for (int d = TypeParam::kMaxDepth - 4; d <= TypeParam::kMaxDepth; ++d)
    tiles.push_back(TestFixture::M::holder({0, 0, 0}, d)),
        tiles.push_back(TestFixture::M::holder({3000, 0, 0}, d));
  cloud.addTiles(tiles);
  VoxelCoord const leaf = this->deepest(0, 0, 0),
                   coarse = TestFixture::M::holder({3000, 0, 0}, TypeParam::kMaxDepth - 2);
  cloud.addPoint(leaf, {0.5f, 0.5f, 0.5f});
  cloud.addPoint(coarse, {3000.5f, 0.5f, 0.5f});
  cloud.counted();
  cloud.reTile(true);
  cloud.check();
  EXPECT_TRUE(cloud.model.has(leaf));
  EXPECT_TRUE(cloud.model.has(TestFixture::M::above(leaf, TypeParam::kMaxDepth - 4)));
  EXPECT_FALSE(cloud.model.has(this->deepest(3000, 0, 0))) << "a leaf without points goes";
  auto const once = cloud.contents();
  cloud.reTile(true);
  cloud.check();
  EXPECT_EQ(cloud.contents(), once) << "pruning again changed something";
}

TYPED_TEST(ReTile, PositionsThatLieInTheObjectMoveOnce) {
  PointCloud<TypeParam> cloud(1.0f);
  auto positions = Ostil::makePtr<typename PointCloud<TypeParam>::Positions>(cloud.positions);
  VoxelCoord const home = this->deepest(0, 0, 0), next = this->deepest(50, 0, 0);
  cloud.addTiles({home, next});
  positions->update(cloud.topology);
  TreeIndex const at = cloud.tree.tileAccessor().tile(home, true).treeIndex();
  positions->tileDataAccessor().tileData(at).push({50.5f, 0.5f, 0.5f});
  cloud.topology.update(*positions);
  cloud.template pushTo<typename PointCloud<TypeParam>::Ids>("ids", at, 1);
  cloud.template pushTo<typename PointCloud<TypeParam>::Weights>("weights", at, 1.0f);
  cloud.object.addComponent(positions);
  channelElementReTile(cloud.tree, cloud.topology, *positions, cloud.object, false);
  EXPECT_EQ(positions->size(), 1u);
  EXPECT_EQ(cloud.object.component("positions").get(), positions.get());
  EXPECT_EQ(cloud.topology.elementCount(-1), 1);
  EXPECT_EQ(cloud.object.template component<typename PointCloud<TypeParam>::Ids>("ids")->size(), 1u);
}

TYPED_TEST(ReTile, RandomMovesFollowTheRules) {
  for (float const voxelSize : {1.0f, 0.5f, 2.0f}) {
    for (std::uint32_t seed = 1; seed <= 6; ++seed) {
      SCOPED_TRACE("seed " + std::to_string(seed) + ", voxel size " + std::to_string(voxelSize));
      PointCloud<TypeParam> cloud(voxelSize);
      this->fill(cloud, seed, 120);
      cloud.check();
      ASSERT_FALSE(this->HasFailure());
      std::mt19937 random(seed);
      for (int step = 0; step < 12; ++step) {
        // Small moves mostly, now and then one of many tiles; all points alike, or each its own way.
        float const far = voxelSize * (step % 4 == 3 ? 300.0f : 2.5f);
        std::uniform_real_distribution<float> along(-far, far);
        float3 const all{along(random), along(random), along(random)};
        bool const same = step % 2 == 0;
        cloud.move([&](float3 const& p) {
          // A function of the position alone, so that model and channel agree.
          if (same) return float3{p.x + all.x, p.y + all.y, p.z + all.z};
          return float3{p.x + all.y * std::sin(p.z), p.y + all.z * std::sin(p.x),
                        p.z + all.x * std::cos(p.y)};
        });
        cloud.reTile(step % 3 == 2);
        cloud.check();
        ASSERT_FALSE(this->HasFailure()) << "step " << step;
      }
    }
  }
}

TYPED_TEST(ReTile, RegressionChannelsThatHoldNoPointsStayWhole) {
  constexpr int kW = TypeParam::kTileDataWidth;
  PointCloud<TypeParam> cloud(1.0f);
  using Wide = Channel<TypeParam, float, kW, 1>;
  using Corners = Channel<TypeParam, float, kW + 1, 0>;
  using Shallow = Channel<TypeParam, int, kW, 0>;
  this->fill(cloud, 5, 80);
  auto const add = [&](auto channel) {
    channel->setTargetName(cloud.topology.name());
    channel->update(cloud.topology);
    cloud.object.addComponent(std::move(channel));
  };
  int const last = TypeParam::kMaxDepth;
  add(Ostil::makePtr<Wide>("wide", nullptr, kInitializeDefaultValue, false, true, 0, last));
  add(Ostil::makePtr<Corners>("corners", nullptr, kInitializeDefaultValue, false, true, 0, last));
  add(Ostil::makePtr<Shallow>("shallow", nullptr, kInitializeDefaultValue, false, true, 0, last - 2));
  std::mt19937 random(5);
  std::uniform_real_distribution<float> along(-40, 40);
  for (std::uint32_t round = 0; round < 4; ++round) {
    float3 const by{along(random), along(random), along(random)};
    cloud.move([&](float3 const& p) { return float3{p.x + by.x, p.y + by.y, p.z + by.z}; });
    cloud.reTile(round % 2 == 1);
    cloud.check();
    auto const wide = cloud.object.template component<Wide>("wide");
    auto const corners = cloud.object.template component<Corners>("corners");
    auto const shallow = cloud.object.template component<Shallow>("shallow");
    ASSERT_EQ(wide->tileCount(-1), cloud.tree.tileCount(-1));
    for (std::int64_t i = 0; i < wide->tileCount(-1); ++i) {
      ASSERT_EQ(wide->tileData(i).size(), Wide::kSize);
      ASSERT_EQ(corners->tileData(i).size(), Corners::kSize);
    }
    ASSERT_EQ(shallow->tileCount(last), 0);
    for (int d = 0; d <= last - 2; ++d)
      ASSERT_EQ(shallow->elementCount(d), cloud.positions.elementCount(d)) << d;
  }
}

TYPED_TEST(ReTile, BytesAreEqualAtAnyNumberOfThreads) {
  std::vector<std::int64_t> first;
  for (int const threads : {1, 2, 8}) {
    PointCloud<TypeParam> cloud(1.0f);
    this->fill(cloud, 77, 800);
    VLN::withThreads(threads, [&] {
      for (int step = 0; step < 3; ++step) {
        cloud.move([&](float3 const& p) { return float3{p.x + 1.3f, p.y - 2.1f, p.z + 0.7f}; });
        channelElementReTile(cloud.tree, cloud.topology, cloud.positions, cloud.object, step == 2);
      }
    });
    if (first.empty()) first = cloud.contents();
    EXPECT_EQ(cloud.contents(), first) << threads;
  }
}

} // namespace
