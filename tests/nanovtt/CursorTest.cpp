// The cursor against single lookups, and its blends against the library's sampler.
#include "GeometryVolume/channels/Halo.h"
#include "GeometryVolume/nanovtt/VTTToNanoVTT.h"
#include "GeometryVolume/sampling/VoxelSamplerLinear.h"
#include "GeometryVolume/topology/Command.h"
#include "Reader/NanoVTTCursor.h"
#include "Reader/NanoVTTStructures.h"

#include <gtest/gtest.h>

#include <cmath>
#include <limits>
#include <random>
#include <set>
#include <string>
#include <vector>

namespace {

using namespace VLN::TileTree3D;
using Shape = PowerOfTwoTraits;
using Buffer = nanovtt::AlignedHostBuffer;

// A ball of fog in tiles of three depths, with roots 64 wide.
struct Ball {
  Ostil::MutablePtr<VLN::Object> object =
      Command::createVoxelVLN<Shape>("voxel_tile_tree", "voxel_component", 1.0f, kVoxelOffsetCorner);
  int rootLevel = 0;

  Ball() {
    auto tree = object->extractComponent<Container<Shape>>("voxel_tile_tree");
    auto accessor = tree->tileAccessor();
    accessor.addTiles(int3{-64, -64, -64}, int3{64, 64, 64}, 24);
    accessor.addTiles(int3{-20, -20, -20}, int3{20, 20, 20}, 27);
    accessor.addTiles(int3{-20, -9, -20}, int3{3, 20, 11}, 28);
    rootLevel = Shape::kMaxDepth - 24;
    auto topology = object->extractComponent<VoxelTopology<Shape>>("voxel_component");
    topology->update(*tree);
    auto field = Command::createChannel<float, 2, 4, 4, 0, 0>("density", *topology, 0.0f,
                                                              kInitializeDefaultValue, 0, Shape::kMaxDepth);
    for (int d = 0; d <= Shape::kMaxDepth; ++d)
      for (std::int64_t n = 0; n < tree->tileCount(d); ++n) {
        auto const& tile = std::as_const(*tree).tile(n, d);
        auto data = field->tileData(tile.treeIndex());
        for (int s = 0; s < 64; ++s) {
          auto const p = tile.childDataTIJK(s % 4, s / 4 % 4, s / 16);
          data(s) = std::max(0.0f, 1.0f - std::hypot(float(p.x), float(p.y), float(p.z)) / 24.0f);
        }
      }
    object->putComponent(std::move(field));
    object->putComponent(std::move(topology));
    object->putComponent(std::move(tree));
  }

  nanovtt::GridHandle<Buffer> flatten(float halo, bool coalesce) const {
    Buffer const pool;
    return nanovtt::vttToNanoVTT<Buffer, void, nanovdb::AbsDiff, true>(
        *object, "density", nanovdb::StatsMode(0), nanovdb::ChecksumMode(0), 0, -1.0f, false, halo, rootLevel,
        0, false, coalesce, false, 1, false, false, 0.0f, false, false, nullptr, nullptr, nullptr, pool);
  }
};

// requirement
TEST(Cursor, RequirementReadsWhatLookupsRead) {
  Ball const ball;
  for (float halo : {0.0f, 0.5f, 1.0f})
    for (bool coalesce : {false, true}) {
      auto const flat = ball.flatten(halo, coalesce);
      auto const grid = nanovtt::BufferReader(flat.data()).grid(0);
      nanovtt::GridCursor cursor(grid);
      std::mt19937 random(3);
      for (int n = 0; n < 50000; ++n) {
        int const x = int(random() % 160) - 80, y = int(random() % 160) - 80, z = int(random() % 40) - 20;
        for (int step = 0; step < 4; ++step) // near each other, so that the tile is found again
          ASSERT_EQ(double(cursor.value(x + step, y, z)), grid.valueAt(x + step, y, z))
              << x + step << ' ' << y << ' ' << z << ", halo " << halo << ", coalesce " << coalesce;
      }
    }
}

// requirement: a table of cells changes no read, of cells as wide as the deepest tiles and of wider ones
TEST(Cursor, RequirementCellsChangeNoRead) {
  Ball const ball;
  for (float halo : {0.0f, 1.0f})
    for (bool coalesce : {false, true}) {
      auto const flat = ball.flatten(halo, coalesce);
      auto const grid = nanovtt::BufferReader(flat.data()).grid(0);
      auto const tree = grid.container();
      std::set<int> depths;
      for (std::uint64_t most = 0; most < 3000000; most = 2 * most + 5) {
        nanovtt::CellTable cells(tree, most);
        ASSERT_LE(cells.bytes(), most);
        ASSERT_EQ(cells.bytes() == 0, cells.depth() < 0);
        std::vector<std::uint32_t> memory(cells.bytes() / 4 + 1, 77);
        cells.write(tree, memory.data());
        ASSERT_EQ(memory.back(), 77u);
        depths.insert(cells.depth());
        for (int maxDepth : {28, 27, 25, 23}) {
          nanovtt::GridCursor with(grid, cells, maxDepth), without(grid, maxDepth);
          std::mt19937 random(6);
          auto const at = [&](int reach) { return int(random() % unsigned(2 * reach)) - reach; };
          for (int n = 0; n < 4000; ++n) {
            int const reach = n % 3 == 0 ? 500 : 80, x = at(reach), y = at(reach), z = at(reach);
            for (int step = 0; step < 3; ++step) {
              ASSERT_EQ(with.value(x + step, y, z), without.value(x + step, y, z))
                  << x + step << ' ' << y << ' ' << z << ", depth " << cells.depth() << " of " << maxDepth;
              float const fx = float(x) + 0.3f * float(step);
              ASSERT_EQ(with.trilinear(fx, float(y), float(z)), without.trilinear(fx, float(y), float(z)));
            }
          }
        }
      }
      // Eight cells are enough at depths 24 and 25.
      if (!coalesce) { EXPECT_EQ(depths, (std::set<int>{-1, 25, 26, 27, 28})); }
      EXPECT_GT(depths.size(), 3u);
    }
}
TEST(Cursor, BoundaryCellsOfCopiesAndOfPlacesFarAway) {
  Ball const ball;
  auto const flat = ball.flatten(0, false);
  auto const grid = nanovtt::BufferReader(flat.data()).grid(0);
  nanovtt::CellTable cells(grid.container());
  EXPECT_EQ(cells.depth(), 28);
  std::vector<std::uint32_t> memory(cells.bytes() / 4);
  // Without its cells a table leads nowhere.
  nanovtt::GridCursor unwritten(grid, cells);
  cells.write(grid.container(), memory.data());
  std::vector<std::uint32_t> const copy = memory;
  std::fill(memory.begin(), memory.end(), 0);
  nanovtt::GridCursor cursor(grid, cells.at(copy.data()));
  constexpr int kEnds[] = {INT32_MIN, INT32_MIN + 1, -(1 << 30), -(1 << 29), -1, 0, 1 << 29, INT32_MAX};
  for (int x : kEnds)
    for (int y : kEnds)
      for (int z : kEnds) {
        ASSERT_EQ(double(cursor.value(x, y, z)), grid.valueAt(x, y, z)) << x << ' ' << y << ' ' << z;
        ASSERT_EQ(double(unwritten.value(x, y, z)), grid.valueAt(x, y, z)) << x << ' ' << y << ' ' << z;
      }
}

// requirement: where the buffer holds the samples, blend and gradient are the library's own, bit for bit
template <class ChannelT>
void expectSamplers(Ball const& ball, nanovtt::GridCursor cursor, ChannelT const& channel,
                    std::string const& label) {
  auto const tree = ball.object->component<Container<Shape>>("voxel_tile_tree");
  auto const topology = ball.object->component<VoxelTopology<Shape>>("voxel_component");
  FloatVoxelSamplerLinear<Shape> const sampler(*tree, *topology, channel);
  std::mt19937 random(4);
  std::uniform_real_distribution<float> within(0.0f, 1.0f);
  for (int n = 0; n < 40000; ++n) {
    // Of the box of the deepest tiles, whose high sides are left out: what lies beyond is coarser.
    float3 p{-20 + 19 * within(random), -8 + 24 * within(random), -20 + 28 * within(random)};
    if (n % 4 == 0) p[n / 4 % 3] = std::floor(p[n / 4 % 3]);                           // on samples
    if (n % 5 == 0) p[n / 5 % 3] = std::nextafter(std::floor(p[n / 5 % 3]), -1000.0f); // just below them
    float3 wanted;
    float got[3];
    float const value = sampler.sampleGradient(p, kSamplerTileSpace, &wanted);
    ASSERT_EQ(cursor.trilinear(p.x, p.y, p.z, got), value) << label << p.x << ' ' << p.y << ' ' << p.z;
    for (int a = 0; a < 3; ++a)
      ASSERT_EQ(got[a], wanted[a]) << label << p.x << ' ' << p.y << ' ' << p.z << " axis " << a;
    ASSERT_EQ(cursor.trilinear(p.x, p.y, p.z), sampler.sample(p, kSamplerTileSpace)) << label;
  }
}
TEST(Cursor, RequirementBlendsAsTheSampler) {
  Ball const ball;
  auto const tree = ball.object->component<Container<Shape>>("voxel_tile_tree");
  auto const topology = ball.object->component<VoxelTopology<Shape>>("voxel_component");
  auto const field = ball.object->component<Channel<Shape, float, 4, 0>>("density");
  float const zero = 0;
  Channel<Shape, float, 5, 0> wide("wide", &zero, kInitializeDefaultValue, false, true, 0, Shape::kMaxDepth);
  wide.update(*topology);
  computeHalo<Shape, float, 0, 0, 1, 0>(*field, *tree, wide, -1, -1);
  for (float halo : {0.0f, 0.5f, 1.0f})
    for (bool coalesce : {false, true}) {
      auto const flat = ball.flatten(halo, coalesce);
      nanovtt::GridCursor const cursor(nanovtt::BufferReader(flat.data()).grid(0));
      auto const label = "halo " + std::to_string(halo) + (coalesce ? ", coalesced: " : ": ");
      expectSamplers(ball, cursor, wide, label);
      expectSamplers(ball, cursor, *field, label);
    }
}

// requirement: a cursor that knows its type blends as the one that does not, of every build
template <nanovtt::GridType kType, class BuildT> void expectTypedBlends(Ball const& ball, float halo) {
  Buffer const pool;
  auto const flat = nanovtt::vttToNanoVTT<Buffer, BuildT, nanovdb::AbsDiff, true>(
      *ball.object, "density", nanovdb::StatsMode(0), nanovdb::ChecksumMode(0), 0, 0.01f, false, halo,
      ball.rootLevel, 0, false, false, false, 1, false, false, 0.0f, false, false, nullptr, nullptr, nullptr,
      pool);
  auto const grid = nanovtt::BufferReader(flat.data()).grid(0);
  ASSERT_EQ(grid.type(), kType);
  nanovtt::GridCursor any(grid);
  nanovtt::Cursor<kType> typed(grid);
  std::mt19937 random(8);
  std::uniform_real_distribution<float> inside(-70.0f, 70.0f);
  for (int n = 0; n < 20000; ++n) {
    float const x = inside(random), y = inside(random), z = inside(random);
    float a[3], b[3];
    ASSERT_EQ(any.trilinear(x, y, z, a), typed.trilinear(x, y, z, b));
    for (int axis = 0; axis < 3; ++axis) ASSERT_EQ(a[axis], b[axis]);
  }
}
TEST(Cursor, RequirementBlendsTheSameWithItsTypeKnown) {
  Ball const ball;
  for (float halo : {0.0f, 1.0f}) {
    expectTypedBlends<nanovtt::GridType::kFloat, void>(ball, halo);
    expectTypedBlends<nanovtt::GridType::kFp4, nanovdb::Fp4>(ball, halo);
    expectTypedBlends<nanovtt::GridType::kFp8, nanovdb::Fp8>(ball, halo);
    expectTypedBlends<nanovtt::GridType::kFp16, nanovdb::Fp16>(ball, halo);
    expectTypedBlends<nanovtt::GridType::kFpN, nanovdb::FpN>(ball, halo);
  }
}

// requirement: the derivative is that of the blend
TEST(Cursor, RequirementGradientIsTheBlendsOwn) {
  Ball const ball;
  for (float halo : {0.0f, 1.0f}) {
    auto const flat = ball.flatten(halo, false);
    nanovtt::GridCursor cursor(nanovtt::BufferReader(flat.data()).grid(0));
    std::mt19937 random(5);
    for (int n = 0; n < 5000; ++n) {
      // Inside of cells of every width, so that a step to both sides stays in the cell.
      float p[3];
      for (float& c : p) c = float(int(random() % 96)) - 48.0f + 0.25f + 0.5f * float(random() % 1000) / 1000;
      float g[3];
      ASSERT_EQ(cursor.trilinear(p[0], p[1], p[2], g), cursor.trilinear(p[0], p[1], p[2]));
      for (int a = 0; a < 3; ++a) {
        float q[3] = {p[0], p[1], p[2]};
        q[a] = p[a] + 0.125f;
        float const above = cursor.trilinear(q[0], q[1], q[2]);
        q[a] = p[a] - 0.125f;
        ASSERT_NEAR(g[a], (above - cursor.trilinear(q[0], q[1], q[2])) / 0.25f, 2e-5f)
            << p[0] << ' ' << p[1] << ' ' << p[2] << " axis " << a << " halo " << halo;
      }
    }
  }
}

// requirement: a cursor that stops above the deepest tiles reads what lookups to that depth read
TEST(Cursor, RequirementStopsAtADepth) {
  Ball const ball;
  auto const flat = ball.flatten(0.5f, false);
  auto const grid = nanovtt::BufferReader(flat.data()).grid(0);
  for (int depth = 24; depth <= 28; ++depth) {
    nanovtt::GridCursor cursor(grid, depth);
    std::mt19937 random(6);
    for (int n = 0; n < 20000; ++n) {
      int const x = int(random() % 100) - 50, y = int(random() % 100) - 50, z = int(random() % 40) - 20;
      ASSERT_EQ(double(cursor.value(x, y, z)), grid.valueAt(x, y, z, 0, depth)) << depth;
    }
  }
}

// requirement: the structures beside the buffer say what the tree says
TEST(Structures, RequirementPlacesAndNeighbours) {
  Ball const ball;
  Buffer const pool;
  Buffer traversal, neighbors;
  auto const flat = nanovtt::vttToNanoVTT<Buffer, void, nanovdb::AbsDiff, true>(
      *ball.object, "density", nanovdb::StatsMode(0), nanovdb::ChecksumMode(0), 0, -1.0f, false, 0.0f,
      ball.rootLevel, 0, false, false, false, 1, false, false, 0.0f, false, true, &traversal, &neighbors,
      nullptr, pool);
  nanovtt::ContainerReader const tree(flat.data());
  ASSERT_TRUE(nanovtt::TraversalReader::holdsRows(traversal.size(), tree.tileCount()));
  ASSERT_TRUE(nanovtt::NeighborReader::holdsRows(neighbors.size(), tree.tileCount()));
  EXPECT_FALSE(nanovtt::TraversalReader::holdsRows(traversal.size() - 1, tree.tileCount()));
  nanovtt::TraversalReader const places(traversal.data());
  nanovtt::NeighborReader const around(neighbors.data());
  int found = 0;
  tree.forEachTile([&](nanovtt::TileRef const& tile) {
    auto const place = places.tile(tile.number);
    EXPECT_EQ(place.depth, tile.depth);
    EXPECT_EQ(place.corner.x, tile.corner.x);
    EXPECT_EQ(place.corner.y, tile.corner.y);
    EXPECT_EQ(place.corner.z, tile.corner.z);
    for (int n = 0; n < 27; ++n) {
      int const dx = n / 9 - 1, dy = n / 3 % 3 - 1, dz = n % 3 - 1, w = tile.width();
      auto const there =
          tree.find(tile.corner.x + dx * w, tile.corner.y + dy * w, tile.corner.z + dz * w, tile.depth);
      ASSERT_EQ(around.neighbor(tile.number, dx, dy, dz), there.number) << tile.number << ' ' << n;
      found += there.valid();
    }
  });
  EXPECT_GT(found, 1000);
}

// negative
TEST(Cursor, NegativePositionsThatAreNone) {
  Ball const ball;
  auto const flat = ball.flatten(1.0f, false);
  nanovtt::GridCursor cursor(nanovtt::BufferReader(flat.data()).grid(0));
  float const huge = std::numeric_limits<float>::max(), nan = std::numeric_limits<float>::quiet_NaN();
  for (float const v :
       {huge, -huge, nan, std::numeric_limits<float>::infinity(), 2147483648.0f, -2147483648.0f})
    for (int axis = 0; axis < 3; ++axis) {
      float p[3] = {0, 0, 0};
      p[axis] = v;
      EXPECT_EQ(cursor.trilinear(p[0], p[1], p[2]), 0.0f) << v;
    }
  EXPECT_EQ(cursor.value(INT32_MAX, 0, INT32_MIN), 0.0f);
}

} // namespace
