// From positions to samples and weights.
#include "sampling/SamplerVolume.h"
#include "support/Print.h"
#include "support/Shapes.h"

#include <cmath>
#include <limits>

namespace VLN::Test {
namespace {

struct Placed {
  bool found;
  TreeIndex tile{7, 7};
  int3 ijk{9, 9, 9};
  float3 weights{9, 9, 9};
  float invVoxelWidth = 9;
};

template <class TraitsT>
Placed place(SamplerVolume<TraitsT> const& volume, float3 const& p, int depth = TraitsT::kMaxDepth,
             SamplerSpace space = kSamplerTileSpace) {
  VoxelSampler<TraitsT, float, float3> const sampler(volume.tree, volume.topology);
  Placed r;
  r.found = sampler.prepareToSample(p, space, r.tile, r.ijk, r.weights, depth, &r.invVoxelWidth);
  return r;
}

VLN_SHAPE_SUITE(PlaceTest);

// requirement: sample and weight in the tile's own widths
TYPED_TEST(PlaceTest, SampleAndWeight) {
  using Traits = TypeParam;
  SamplerVolume<Traits> volume;
  volume.add({0, 0, 0}, Traits::kMaxDepth, Traits::kMaxDepth - 1);
  auto const& fine = std::as_const(volume.tree).tile(0, Traits::kMaxDepth);
  auto const& coarse = std::as_const(volume.tree).tile(0, Traits::kMaxDepth - 1);
  float const x = float(fine.ti()), y = float(fine.tj()), z = float(fine.tk());
  Placed const p = place(volume, {x + 1.25f, y + 0.5f, z + 3.0f});
  EXPECT_TRUE(p.found);
  EXPECT_EQ(p.tile, fine.treeIndex());
  EXPECT_EQ(p.ijk, (int3{1, 0, 3}));
  EXPECT_EQ(p.weights, (float3{0.25f, 0.5f, 0.0f}));
  EXPECT_EQ(p.invVoxelWidth, float(Traits::kTW) / float(Traits::kTDW));
  // The same place at the coarser depth: samples are kTW times as wide.
  Placed const c = place(volume, {x + 1.25f, y + 0.5f, z + 3.0f}, Traits::kMaxDepth - 1);
  EXPECT_EQ(c.tile, coarse.treeIndex());
  for (int a = 0; a < 3; ++a) {
    float const at[3] = {x + 1.25f, y + 0.5f, z + 3.0f};
    float const l = (at[a] - float(coarse.tijk()[a])) / float(Traits::kTW);
    EXPECT_NEAR(float(c.ijk[a]) + c.weights[a], l, 1e-6f);
  }
  // Deeper than any tile: the deepest there is.
  EXPECT_EQ(place(volume, {x, y, z}, 100).tile, fine.treeIndex());
}

// boundary: a place just under a sample snaps to it, one further below does not
TYPED_TEST(PlaceTest, SnapsJustUnderTheFirstSample) {
  using Traits = TypeParam;
  SamplerVolume<Traits> volume(kVoxelOffsetCenter);
  volume.add({0, 0, 0}, Traits::kMaxDepth, Traits::kMaxDepth);
  auto const& tile = std::as_const(volume.tree).tile(0, Traits::kMaxDepth);
  float const x = float(tile.ti()), y = float(tile.tj()), z = float(tile.tk());
  // Positions are of few digits there, so that the differences are what they say.
  Placed const p = place(volume, {x + 0.5f - 5e-6f, y + 0.5f - 2e-5f, z});
  EXPECT_EQ(p.ijk, (int3{0, -1, -1}));
  EXPECT_EQ(p.weights.x, 0.0f);
  EXPECT_NEAR(p.weights.y, 1.0f, 3e-5f);
  EXPECT_LT(p.weights.y, 1.0f);
  EXPECT_EQ(p.weights.z, 0.5f);
  // At the top the sample is held and the weight grows.
  constexpr int D = Traits::kTDW;
  Placed const q = place(volume, {x + D - 0.25f, y + D - 0.5f, z + 1.0f});
  EXPECT_EQ(q.ijk, (int3{D - 1, D - 1, 0}));
  EXPECT_EQ(q.weights, (float3{0.25f, 0.0f, 0.5f}));
}

// boundary: floor, also of negative whole numbers
TYPED_TEST(PlaceTest, NegativeCoordinates) {
  using Traits = TypeParam;
  SamplerVolume<Traits> volume;
  int const w = Traits::width(Traits::kMaxDepth), low = Traits::align(-1, Traits::kMaxDepth);
  volume.add({low, low, low}, Traits::kMaxDepth, Traits::kMaxDepth);
  EXPECT_TRUE(place(volume, {float(low), -1.0f, -1.0f}).found);
  EXPECT_FALSE(place(volume, {float(low) - 1e-3f, -1.0f, -1.0f}).found);
  EXPECT_TRUE(place(volume, {float(low + w) - 1e-3f, -1.0f, -1.0f}).found);
  EXPECT_FALSE(place(volume, {float(low + w), -1.0f, -1.0f}).found);
  EXPECT_EQ(place(volume, {-1.0f, -1.0f, -1.0f}).ijk, (int3{-1 - low, -1 - low, -1 - low}));
}

// negative: nothing there; only the index is written
TYPED_TEST(PlaceTest, NothingThere) {
  using Traits = TypeParam;
  SamplerVolume<Traits> volume;
  volume.add({0, 0, 0}, 6, 5);
  float const nan = std::numeric_limits<float>::quiet_NaN(), inf = std::numeric_limits<float>::infinity();
  float const far = float(Traits::width(5)) * 3;
  auto const expectNone = [&](float3 const& p, int depth) {
    Placed const r = place(volume, p, depth);
    EXPECT_FALSE(r.found);
    EXPECT_EQ(r.tile, TreeIndex{});
    EXPECT_EQ(r.ijk, (int3{9, 9, 9}));
    EXPECT_EQ(r.weights, (float3{9, 9, 9}));
  };
  for (float bad : {nan, inf, -inf, 1e30f, -1e30f, 2147483648.0f, -2147483648.0f, far}) {
    expectNone({bad, 0, 0}, 28);
    expectNone({0, bad, 0}, 28);
    expectNone({0, 0, bad}, 28);
  }
  for (int depth : {-1, -2, -1000000, std::numeric_limits<int>::min(), 4, 0}) expectNone({0, 0, 0}, depth);
  EXPECT_TRUE(place(volume, {0, 0, 0}, 5).found);
  SamplerVolume<Traits> empty;
  expectNone({far, far, far}, 28);
  EXPECT_FALSE(place(empty, {0, 0, 0}).found);
}

// regression: what a sampler remembers of a coarse tile answers no request above the tree
TYPED_TEST(PlaceTest, RegressionNothingIsRememberedAboveTheTree) {
  using Traits = TypeParam;
  SamplerVolume<Traits> volume;
  constexpr int kCoarse = Traits::kMaxDepth - 2;
  volume.add({0, 0, 0}, kCoarse, kCoarse);
  auto const& coarse = std::as_const(volume.tree).tile(0, kCoarse);
  int3 const low = coarse.tijk(), high = coarse.childTIJK({Traits::kTW - 1, 0, 0});
  volume.add(high, Traits::kMaxDepth, Traits::kMaxDepth);
  VoxelSampler<Traits, float, float3> const sampler(volume.tree, volume.topology);
  auto const find = [&](int3 const& p, int depth) {
    TreeIndex at;
    int3 ijk;
    float3 weights;
    sampler.prepareToSample({float(p.x), float(p.y), float(p.z)}, kSamplerTileSpace, at, ijk, weights, depth,
                            nullptr);
    return at;
  };
  ASSERT_EQ(find(low, Traits::kMaxDepth).depth, kCoarse);
  ASSERT_EQ(find(high, Traits::kMaxDepth).depth, Traits::kMaxDepth);
  for (int const depth : {-1, std::numeric_limits<int>::min()})
    EXPECT_EQ(find(low, depth), TreeIndex{}) << depth;
}

// requirement: world space is scaled, any other is tile space; a voxel size of 0 maps all to the origin
TYPED_TEST(PlaceTest, Spaces) {
  using Traits = TypeParam;
  SamplerVolume<Traits> volume(kVoxelOffsetCorner, 0.25f);
  volume.add({8, 8, 8}, Traits::kMaxDepth, Traits::kMaxDepth - 3);
  Placed const tile = place(volume, {8.5f, 8.25f, 8.0f});
  for (int space : {1, 0, 3, -1})
    EXPECT_EQ(place(volume, {8.5f, 8.25f, 8.0f}, 28, static_cast<SamplerSpace>(space)).ijk, tile.ijk);
  Placed const world = place(volume, {2.125f, 2.0625f, 2.0f}, 28, kSamplerWorldSpace);
  EXPECT_EQ(world.tile, tile.tile);
  EXPECT_EQ(world.ijk, tile.ijk);
  EXPECT_EQ(world.weights, tile.weights);
  EXPECT_EQ(kSamplerTileSpace, 0);
  EXPECT_EQ(kSamplerVoxelSpace, 1);
  EXPECT_EQ(kSamplerWorldSpace, 2);

  SamplerVolume<Traits> flat(kVoxelOffsetCorner, 0.0f);
  flat.add({0, 0, 0}, Traits::kMaxDepth, Traits::kMaxDepth);
  EXPECT_TRUE(place(flat, {1e6f, -5.0f, 77.0f}, 28, kSamplerWorldSpace).found);
}

// regression: the widest tiles and the ends of the domain
TYPED_TEST(PlaceTest, EndsOfTheDomain) {
  using Traits = TypeParam;
  SamplerVolume<Traits> volume;
  volume.add({0, 0, 0}, 0, 0);
  float const low = float(Traits::kMinTileCoord), high = float(Traits::kMaxTileCoord) * 0.999f;
  Placed const a = place(volume, {low, low, low}), b = place(volume, {high, high, high});
  if (Traits::kTW == 2) { // the odd shape's ends are no floats
    EXPECT_TRUE(a.found);
    EXPECT_EQ(a.ijk, (int3{0, 0, 0}));
  }
  EXPECT_TRUE(b.found);
  EXPECT_EQ(b.ijk, (int3{Traits::kTDW - 1, Traits::kTDW - 1, Traits::kTDW - 1}));
}

} // namespace
} // namespace VLN::Test
