// Halo tables: what serves each direction around a tile, plain and packed.
#include "support/Print.h"
#include "support/RandomForest.h"
#include "support/Shapes.h"

#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/tiletree/TileHalo.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cmath>
#include <cstring>
#include <utility>
#include <vector>

using namespace VLN::TileTree3D;
using Support::Access;

VLN_SHAPE_SUITE(Halos);

namespace {

template <class T> Container<T> forestOf(std::uint32_t seed, int additions = 14) {
  Support::RandomForest<T> forest(seed);
  for (int n = 0; n < additions; ++n) forest.grow();
  return forest.tree();
}

/// Reads fields of a few bits from the low end of each byte.
struct BitReader {
  CompressedTileHalo const& record;
  std::size_t at = 0;
  unsigned read(int bits) {
    unsigned value = 0;
    for (int b = 0; b < bits; ++b, ++at) {
      EXPECT_LT(at / 8, record.size) << "the record ends too early";
      if (at / 8 < record.size && (record.bytes[at / 8] >> (at % 8) & 1)) value |= 1u << b;
    }
    return value;
  }
};

/// Weight of the coarse sample at the low side of the region's first sample, on each axis 1 minus its
/// distance in coarse samples.
template <class T> double weightOf(typename Container<T>::TileType const& t, int direction, int levels) {
  std::int64_t const fine = T::width(t.depth()) / T::kTDW, coarse = T::width(t.depth() - levels) / T::kTDW;
  double weight = 1;
  for (int a = 0; a < 3; ++a) {
    int const step = neighborOffset(direction)[a];
    std::int64_t const first = step < 0 ? -1 : step == 0 ? 0 : T::kTDW;
    std::int64_t const u = t.tijk()[a] - std::int64_t(T::kMinTileCoord) + first * fine;
    std::int64_t const low = u >= 0 ? u / coarse * coarse : -((-u + coarse - 1) / coarse) * coarse;
    weight *= 1 - double(u - low) / double(coarse);
  }
  return weight;
}

} // namespace

// requirement
TYPED_TEST(Halos, RecordsNameTheNeighborsAndTheirLevels) {
  using T = TypeParam;
  for (std::uint32_t seed = 1; seed <= 10; ++seed) {
    SCOPED_TRACE("seed " + std::to_string(seed));
    Support::RandomForest<T> forest(40 + seed);
    for (int n = 0; n < 14; ++n) forest.grow();
    forest.tree().precomputeTileHalos();
    auto const& tree = std::as_const(forest.tree());
    auto const accessor = tree.tileAccessor();
    for (int n = 0; n < 60 && !tree.empty(); ++n) {
      auto const& t =
          tree.tile(static_cast<std::int64_t>(forest.pick(0, static_cast<int>(tree.tileCount(-1)) - 1)));
      auto const* halo = accessor.tileHalo(t.treeIndex());
      ASSERT_NE(halo, nullptr);
      ASSERT_EQ(halo, tree.tileHalo(t.treeIndex()));
      for (int dir = 0; dir < kNeighborCount; ++dir) {
        auto const at = static_cast<std::size_t>(dir);
        auto const expected = forest.model().beside(t.voxelCoord(), neighborOffset(dir));
        if (!expected) {
          ASSERT_EQ(halo->neighbors[at], TreeIndex{});
          ASSERT_EQ(halo->levelDifference[at], -1);
        } else {
          ASSERT_EQ(tree.tile(halo->neighbors[at]).voxelCoord(), *expected);
          ASSERT_EQ(halo->levelDifference[at], t.depth() - expected->depth);
        }
      }
    }
    forest.tree().clearTileHalos();
    ASSERT_EQ(tree.tileHalo({0, 0}), nullptr);
  }
}

// requirement
TYPED_TEST(Halos, NoTableGivesNullAndAnEndedVisitor) {
  using T = TypeParam;
  Container<T> tree;
  tree.tileAccessor().addTile(0, 0, 0, 3);
  EXPECT_EQ(tree.tileHalo({0, 3}), nullptr);
  auto const visitor = tree.tileHaloVisitor({0, 3});
  EXPECT_TRUE(visitor.end());
  EXPECT_EQ(visitor.count(), 0);
  EXPECT_EQ(visitor.sameDepthCount(), 0);
  EXPECT_EQ(visitor.coarserCount(), 0);
  EXPECT_TRUE(tree.tileAccessor().tileHaloVisitor({0, 3}).end());
}

// requirement: the packed bytes, field by field, and the visitor's reading of them
TYPED_TEST(Halos, PackedRecordsSayWhatThePlainOnesSay) {
  using T = TypeParam;
  for (std::uint32_t seed = 1; seed <= 10; ++seed) {
    SCOPED_TRACE("seed " + std::to_string(seed));
    auto tree = forestOf<T>(60 + seed);
    tree.precomputeTileHalos();
    tree.precomputeCompressedTileHalos();
    auto const& records = Access::data(tree).m_compressedHalos->records;
    for (std::int64_t n = 0; n < tree.tileCount(-1); ++n) {
      auto const& t = tree.tile(n);
      TreeIndex const at = t.treeIndex();
      auto const& halo = *tree.tileHalo(at);
      std::vector<int> same, coarser;
      for (int dir = 0; dir < kNeighborCount; ++dir) {
        int const levels = halo.levelDifference[static_cast<std::size_t>(dir)];
        if (dir == kNeighborSelf) continue;
        if (levels == 0) same.push_back(dir);
        if (levels > 0) coarser.push_back(dir);
      }
      auto const& record = records[static_cast<std::size_t>(at.depth)][static_cast<std::size_t>(at.index)];
      BitReader bits{record};
      auto visitor = tree.tileHaloVisitor(at);
      ASSERT_EQ(record.bytes[0] & 31u, same.size()) << "the low 5 bits of the first byte";
      ASSERT_EQ(bits.read(5), same.size());
      ASSERT_EQ(bits.read(6), coarser.size());
      ASSERT_EQ(visitor.sameDepthCount(), static_cast<int>(same.size()));
      ASSERT_EQ(visitor.coarserCount(), static_cast<int>(coarser.size()));
      ASSERT_EQ(visitor.count(), static_cast<int>(same.size() + coarser.size()));
      for (int dir : same) {
        ASSERT_FALSE(visitor.end());
        ASSERT_EQ(bits.read(5), static_cast<unsigned>(dir));
        ASSERT_EQ(visitor.direction(), dir);
        ASSERT_EQ(visitor.levelDifference(), 0);
        ASSERT_EQ(visitor.weight(), 1.0f);
        visitor.next();
      }
      for (int dir : coarser) {
        int const levels = halo.levelDifference[static_cast<std::size_t>(dir)];
        ASSERT_FALSE(visitor.end());
        ASSERT_EQ(bits.read(5), static_cast<unsigned>(dir));
        ASSERT_EQ(bits.read(2), levels > 3 ? 0u : static_cast<unsigned>(levels));
        unsigned const weight = bits.read(9);
        ASSERT_LT(weight, 261u);
        ASSERT_EQ(visitor.direction(), dir);
        ASSERT_EQ(visitor.levelDifference(), std::min(levels, 4));
        ASSERT_EQ(visitor.weight(), haloWeights()[weight]);
        double const exact = weightOf<T>(t, dir, levels);
        ASSERT_EQ(weight, static_cast<unsigned>(nearestHaloWeight(static_cast<float>(exact))))
            << t.voxelCoord() << " direction " << dir << " levels " << levels << " weight " << exact;
        if (T::kTW == 2 && levels <= 3) { ASSERT_EQ(static_cast<double>(visitor.weight()), exact); }
        visitor.next();
      }
      ASSERT_TRUE(visitor.end());
      ASSERT_EQ(record.size, (bits.at + 7) / 8) << "no byte too many";
    }
  }
}

// boundary: a tile with nothing around it, and one with all 26 at its own depth
TYPED_TEST(Halos, CountsReachFromNoneToTwentySix) {
  using T = TypeParam;
  int const w = T::width(T::kMaxDepth), x = T::align(100, T::kMaxDepth);
  Container<T> tree;
  auto accessor = tree.tileAccessor();
  accessor.addTiles({x - w, x - w, x - w}, {x + 2 * w, x + 2 * w, x + 2 * w}, T::kMaxDepth);
  TreeIndex const centre = accessor.tile(x, x, x, T::kMaxDepth, true).treeIndex();
  TreeIndex const lonely = accessor.addTile(T::kMaxTileCoord, 0, 0, 7).treeIndex();
  tree.precomputeCompressedTileHalos();
  EXPECT_EQ(tree.tileHaloVisitor(centre).sameDepthCount(), 26);
  EXPECT_EQ(tree.tileHaloVisitor(centre).coarserCount(), 0);
  EXPECT_EQ(tree.tileHaloVisitor(lonely).count(), 0);
  EXPECT_TRUE(tree.tileHaloVisitor(lonely).end());
  Container<T> deep;
  auto walker = deep.tileAccessor();
  walker.addTile(0, 0, 0, 0);
  TreeIndex const inner =
      walker.addTile(T::kMinTileCoord / 3, T::kMinTileCoord / 3, T::kMinTileCoord / 3, T::kMaxDepth)
          .treeIndex();
  deep.precomputeCompressedTileHalos();
  auto const visitor = deep.tileHaloVisitor(inner);
  EXPECT_EQ(visitor.sameDepthCount() + visitor.coarserCount(), 26);
  EXPECT_GE(visitor.coarserCount(), 19);
}

// requirement: bytes do not depend on the number of threads
TYPED_TEST(Halos, TablesAreTheSameAtAnyNumberOfThreads) {
  using T = TypeParam;
  auto const bytesAt = [](int threads) {
    auto tree = forestOf<T>(7, 20);
    tree.tileAccessor().addTiles({0, 0, 0}, {60, 60, 60}, T::kMaxDepth);
    VLN::withThreads(threads, [&] {
      tree.precomputeTileNeighbors();
      tree.precomputeTileHalos();
      tree.precomputeCompressedTileHalos();
    });
    std::vector<std::uint8_t> bytes;
    auto const append = [&](auto const& value) {
      auto const* p = reinterpret_cast<std::uint8_t const*>(&value);
      bytes.insert(bytes.end(), p, p + sizeof value);
    };
    for (int d = 0; d <= T::kMaxDepth; ++d) {
      auto const at = static_cast<std::size_t>(d);
      for (auto const& record : (*tree.neighborData())[at]) {
        for (TreeIndex const& n : record) append(n.index), append(n.depth);
      }
      for (auto const& record : Access::data(tree).m_compressedHalos->records[at])
        bytes.insert(bytes.end(), record.bytes, record.bytes + record.size);
      for (std::int64_t n = 0; n < tree.tileCount(d); ++n) append(tree.tileHalo({n, d})->levelDifference);
    }
    return bytes;
  };
  auto const one = bytesAt(1);
  EXPECT_GT(one.size(), 10000u);
  EXPECT_TRUE(bytesAt(2) == one);
  EXPECT_TRUE(bytesAt(8) == one);
}

// requirement: dead tiles have a record that says nothing
TYPED_TEST(Halos, DeadTilesHaveEmptyRecords) {
  using T = TypeParam;
  Container<T> tree;
  auto accessor = tree.tileAccessor();
  int const w = T::width(6), x = T::align(0, 6);
  accessor.addTile(x, x, x, 6);
  TreeIndex const dead = accessor.addTile(x + w, x, x, 6).treeIndex();
  Access::killLeafTile(tree, dead);
  tree.precomputeTileHalos();
  tree.precomputeCompressedTileHalos();
  EXPECT_NE(tree.tileHalo(dead), nullptr);
  for (TreeIndex const& n : tree.tileHalo(dead)->neighbors) EXPECT_FALSE(n.valid());
  for (int levels : tree.tileHalo(dead)->levelDifference) EXPECT_EQ(levels, -1);
  EXPECT_TRUE(tree.tileHaloVisitor(dead).end());
}
