// Requirement and boundary tests of the voxel and point topologies.
#include "GeometryVolume/core/Const.h"
#include "GeometryVolume/topology/PointTopology.h"
#include "GeometryVolume/topology/VoxelTopology.h"

#include <cmath>
#include <gtest/gtest.h>
#include <sstream>

using namespace VLN;
using namespace VLN::TileTree3D;

namespace {

/// A tree component that reports the same element count for every tile of the depths it knows.
class FixedCounts final : public TileTree3D::Component {
public:
  FixedCounts(int elements, int depths)
      : m_elements(elements)
      , m_depths(depths) {}
  std::uint64_t size() const override { return 0; }
  void update(VLN::Component const&) override {}
  std::int64_t elementCount(int) const override { return 0; }
  int elementCount(TreeIndex const&) const override { return m_elements; }
  std::int64_t tileCount(int depth) const override { return depth < m_depths ? 1000 : 0; }

private:
  int m_elements, m_depths;
};

/// A component that has nothing to do with trees.
class Unrelated final : public VLN::Component {
public:
  std::uint64_t size() const override { return 7; }
  void update(VLN::Component const&) override {}
};

template <class TraitsT> Container<TraitsT> threeTilesAtDepth2(float voxelSize = 1.0f) {
  Container<TraitsT> tree("tree", voxelSize);
  int const w = TraitsT::width(2);
  auto accessor = tree.tileAccessor();
  for (int n = 0; n < 3; ++n)
    accessor.addTile(TraitsT::kMinTileCoord + (n % 2) * w, TraitsT::kMinTileCoord,
                     TraitsT::kMinTileCoord + (n / 2) * w, 2);
  return tree;
}

} // namespace

TEST(VoxelTopology, CountsFollowTheContainer) {
  auto const tree = threeTilesAtDepth2<PowerOfTwoTraits>();
  VoxelTopology<PowerOfTwoTraits> topology("topo", kVoxelOffsetCenter);
  EXPECT_EQ(topology.tileCount(-1), 0);
  topology.update(tree);
  EXPECT_EQ(topology.tileCount(2), 3);
  EXPECT_EQ(topology.tileCount(-1), 3);
  EXPECT_EQ(topology.elementCount(2), 192);
  EXPECT_EQ(topology.elementCount(-1), 192);
  for (std::int64_t n = 0; n < 3; ++n) EXPECT_EQ(topology.elementCount(TreeIndex{n, 2}), 64);
  EXPECT_EQ(topology.size(), 24u);
}

TEST(VoxelTopology, OddShapeHas125ElementsATile) {
  auto const tree = threeTilesAtDepth2<OddTraits>();
  VoxelTopology<OddTraits> topology("topo", kVoxelOffsetCenter);
  topology.update(tree);
  EXPECT_EQ(topology.elementCount(2), 375);
  EXPECT_EQ(topology.size(), 375u);
  // Depths that the shape lacks answer 0: channels ask for 29 of them.
  EXPECT_EQ(topology.tileCount(13), 0);
  EXPECT_EQ(topology.elementCount(28), 0);
}

TEST(VoxelTopology, SpacesIncludeTheOffset) {
  auto const tree = threeTilesAtDepth2<PowerOfTwoTraits>(0.5f);
  VoxelTopology<PowerOfTwoTraits> topology("topo", kVoxelOffsetCenter);
  topology.update(tree);
  EXPECT_EQ(topology.toTileSpace({1, 1, 1}), (float3{1.5f, 1.5f, 1.5f}));
  EXPECT_EQ(topology.toWorldSpace({1.5f, 1.5f, 1.5f}), (float3{1, 1, 1}));
}

TEST(VoxelTopology, OffsetTable) {
  float3 const expected[8] = {{0.5f, 0.5f, 0.5f}, {0, 0.5f, 0.5f}, {0.5f, 0, 0.5f}, {0, 0, 0.5f},
                              {0.5f, 0.5f, 0},    {0, 0.5f, 0},    {0.5f, 0, 0},    {0, 0, 0}};
  for (int type = 0; type < 8; ++type)
    EXPECT_EQ(VoxelTopology<PowerOfTwoTraits>("t", VoxelOffsetType(type)).offset(), expected[type]) << type;
}

TEST(VoxelTopology, NeverFallsBelowAFullTile) {
  auto const tree = threeTilesAtDepth2<PowerOfTwoTraits>();
  VoxelTopology<PowerOfTwoTraits> topology("topo", kVoxelOffsetCenter);
  topology.update(tree);
  topology.update(FixedCounts(10, 29));
  EXPECT_EQ(topology.elementCount(TreeIndex{0, 2}), 64);
  topology.update(FixedCounts(100, 29));
  EXPECT_EQ(topology.elementCount(TreeIndex{0, 2}), 100);
  EXPECT_EQ(topology.elementCount(2), 300);
  EXPECT_EQ(topology.elementCount(-1), 300);
  EXPECT_EQ(topology.tileCount(2), 3);
  // A source that covers fewer depths has no elements for the others.
  topology.update(FixedCounts(100, 1));
  EXPECT_EQ(topology.elementCount(2), 192);
}

TEST(VoxelTopology, ZeroVoxelSizeStoresAnInfiniteInverse) {
  Container<PowerOfTwoTraits> const tree("tree", 0.0f);
  VoxelTopology<PowerOfTwoTraits> topology("topo", kVoxelOffsetCorner);
  topology.update(tree);
  EXPECT_TRUE(std::isinf(topology.toTileSpace({1, 1, 1}).x));
}

TEST(VoxelTopology, UnrelatedSourceIsIgnored) {
  auto const tree = threeTilesAtDepth2<PowerOfTwoTraits>();
  VoxelTopology<PowerOfTwoTraits> topology("topo", kVoxelOffsetCenter);
  topology.update(tree);
  topology.update(Unrelated());
  EXPECT_EQ(topology.elementCount(2), 192);
}

TEST(PointTopology, NewTilesHoldNoPoints) {
  auto tree = threeTilesAtDepth2<PowerOfTwoTraits>();
  PointTopology<PowerOfTwoTraits> topology("points");
  topology.update(tree);
  EXPECT_EQ(topology.elementCount(-1), 0);
  topology.update(FixedCounts(5, 29));
  EXPECT_EQ(topology.elementCount(-1), 15);
  EXPECT_EQ(topology.size(), 15u);
  tree.tileAccessor().addTile(PowerOfTwoTraits::kMaxTileCoord, 0, 0, 2);
  topology.update(tree);
  EXPECT_EQ(topology.elementCount(-1), 15);
  EXPECT_EQ(topology.tileCount(2), 4);
  EXPECT_EQ(topology.elementCount(TreeIndex{3, 2}), 0);
  topology.update(FixedCounts(0, 29));
  EXPECT_EQ(topology.elementCount(-1), 0);
}

TEST(Topologies, EmptyNamesTakeTheDefaults) {
  EXPECT_EQ(VoxelTopology<PowerOfTwoTraits>("", kVoxelOffsetCenter).name(), Const::TileTreeVoxelTopologyName);
  EXPECT_EQ(PointTopology<PowerOfTwoTraits>("").name(), Const::TileTreePointTopologyName);
}

TEST(Topologies, CopyToCarriesEverything) {
  auto const tree = threeTilesAtDepth2<PowerOfTwoTraits>(0.25f);
  VoxelTopology<PowerOfTwoTraits> topology("topo", kVoxelOffsetFaceX);
  topology.setTargetName("tree");
  topology.update(tree);
  Ostil::Ptr<VLN::Component> target;
  topology.copyTo(target);
  auto const copy = Ostil::dynamicCast<VoxelTopology<PowerOfTwoTraits>>(target);
  ASSERT_TRUE(copy);
  EXPECT_EQ(copy->name(), "topo");
  EXPECT_EQ(copy->getTargetName(), "tree");
  EXPECT_EQ(copy->offsetType(), kVoxelOffsetFaceX);
  EXPECT_EQ(copy->elementCount(2), 192);
  EXPECT_EQ(copy->voxelSize(), 0.25f);
  copy->copyTo(target); // onto itself
  EXPECT_EQ(target.get(), copy.get());
}

TEST(Topologies, DumpNamesItsFigures) {
  auto const tree = threeTilesAtDepth2<PowerOfTwoTraits>();
  VoxelTopology<PowerOfTwoTraits> voxels("topo", kVoxelOffsetFaceZ);
  voxels.update(tree);
  std::ostringstream os;
  voxels.dump(os);
  EXPECT_NE(os.str().find("tileCountTotal {3}"), std::string::npos) << os.str();
  EXPECT_NE(os.str().find("tileCount[2] = 3\n"), std::string::npos);
  EXPECT_NE(os.str().find("offsetType = 4\n"), std::string::npos);
  EXPECT_NE(os.str().find("voxelSizeInv = 1\n"), std::string::npos);
  PointTopology<PowerOfTwoTraits> points("points");
  points.update(tree);
  std::ostringstream pointsOs;
  points.dump(pointsOs);
  EXPECT_NE(pointsOs.str().find("elementCountTotal {0}"), std::string::npos);
  EXPECT_NE(pointsOs.str().find("elementCount[28] = 0\n"), std::string::npos);
}

TEST(Topologies, MemoryCountsFourBytesATile) {
  auto const tree = threeTilesAtDepth2<PowerOfTwoTraits>();
  PointTopology<PowerOfTwoTraits> topology("points");
  std::uint64_t emptyUsed = 0, emptyHeld = 0, used = 0, held = 0;
  topology.memUse(emptyUsed, emptyHeld, false);
  topology.update(tree);
  topology.memUse(used, held, false);
  EXPECT_EQ(used, emptyUsed + 12);
  EXPECT_GE(held, used);
}
