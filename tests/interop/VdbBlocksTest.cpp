// What the importer plans trees with: lists of blocks, and narrow tiles among others of their value.
#include "Interop/VdbGridSourceImpl.h"
#include "Interop/VdbTilesRoundImpl.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <map>
#include <random>
#include <tuple>

namespace {

using namespace VLN;
using namespace VLN::Interop;
using Velorn::Math::int3;

using Model = std::map<std::tuple<int, int, int>, unsigned>;

void add(Model& model, BlockList const& list) {
  for (auto const& [place, blocks] : list) model[{place.x, place.y, place.z}] |= blocks;
}

bool holdsAll(BlockList const& list, Model const& model) {
  return list.size() == model.size() && std::all_of(list.begin(), list.end(), [&](PlaceBlocks const& b) {
           auto const found = model.find({b.place.x, b.place.y, b.place.z});
           return found != model.end() && found->second == b.blocks;
         });
}

bool inOrder(std::vector<int3> const& corners) {
  for (std::size_t n = 1; n < corners.size(); ++n)
    if (!TileTree3D::mortonLess(corners[n - 1], corners[n])) return false;
  return true;
}

BlockList someBlocks(std::mt19937& random, std::size_t count) {
  BlockList list;
  for (std::size_t n = 0; n < count; ++n)
    list.push_back({{8 * int(random() % 5), 8 * (int(random() % 5) - 2), 8 * (int(random() % 3) - 1)},
                    unsigned(random() % 256) & unsigned(random() % 256)});
  return list;
}

// requirement
TEST(VdbBlocks, PlacesAreSortedAndJoined) {
  std::mt19937 random(8);
  for (int round = 0; round < 50; ++round) {
    SCOPED_TRACE(round);
    BlockList a = someBlocks(random, random() % 30), b = someBlocks(random, random() % 30);
    Model modelOfA, modelOfBoth;
    add(modelOfA, a), add(modelOfBoth, a), add(modelOfBoth, b);
    sortPlaces(a), sortPlaces(b);
    EXPECT_TRUE(holdsAll(a, modelOfA));
    BlockList const both = unionOf(a, b);
    EXPECT_TRUE(holdsAll(both, modelOfBoth));
    std::vector<int3> places;
    for (PlaceBlocks const& p : both) places.push_back(p.place);
    EXPECT_TRUE(inOrder(places));
  }
}

// requirement: the corners of blocks are along the curve without being sorted
TEST(VdbBlocks, CornersFollowTheCurve) {
  std::mt19937 random(9);
  BlockList list = someBlocks(random, 60);
  list.push_back({{-8, -8, -8}, 0xFF});
  sortPlaces(list);
  std::vector<int3> const corners = cornersOf(list);
  EXPECT_EQ(corners.size(), countBlocks(list));
  EXPECT_TRUE(inOrder(corners));
  for (int n = 0; n < 8; ++n)
    EXPECT_NE(std::find(corners.begin(), corners.end(),
                        int3{-8 + 4 * (n >> 2), -8 + 4 * (n >> 1 & 1), -8 + 4 * (n & 1)}),
              corners.end())
        << n;
}

// requirement
TEST(VdbCorners, AreAddedOnce) {
  std::mt19937 random(10);
  auto const some = [&] {
    std::vector<int3> list;
    for (std::size_t n = random() % 20; n > 0; --n)
      list.push_back({int(random() % 4) - 2, int(random() % 3), 0});
    return list;
  };
  for (int round = 0; round < 50; ++round) {
    SCOPED_TRACE(round);
    std::vector<int3> corners;
    addSorted(corners, some());
    auto const others = some();
    auto const before = corners;
    addSorted(corners, others);
    EXPECT_TRUE(inOrder(corners));
    for (auto const& list : {before, others})
      for (int3 const& c : list) EXPECT_NE(std::find(corners.begin(), corners.end(), c), corners.end());
    for (int3 const& c : corners)
      EXPECT_TRUE(std::find(before.begin(), before.end(), c) != before.end() ||
                  std::find(others.begin(), others.end(), c) != others.end());
  }
}

// requirement: against a look at each of the 27 places
TEST(VdbTilesRound, TellsWhichLieAmongOthersOfTheirValue) {
  using Tree = openvdb::FloatTree;
  using Round = TilesRound<Tree>;
  openvdb::initialize();
  std::mt19937 random(11);
  Tree tree(3.0f);
  constexpr float kValue = -3.0f;
  // Eight nodes of narrow tiles, with leaves and other values among them, and wide tiles beside.
  for (int x = -128; x < 128; x += 8)
    for (int y = -128; y < 128; y += 8)
      for (int z = -128; z < 128; z += 8) {
        unsigned const kind = random() % 400;
        openvdb::Coord const c(x, y, z);
        if (kind == 0)
          tree.touchLeaf(c);
        else if (kind == 1)
          tree.addTile(1, c, 7.0f, false);
        else if (kind > 2) // the others stay the background
          tree.addTile(1, c, kValue, kind % 2 == 0);
      }
  for (int y = -128; y < 128; y += 128)
    for (int z = -128; z < 128; z += 128) {
      tree.addTile(2, openvdb::Coord(128, y, z), kValue, false);
      tree.addTile(2, openvdb::Coord(-256, y, z), 7.0f, false);
    }
  Round const round(tree, kValue);
  PlaceSearch<Tree> search(tree);
  auto const isValue = [&](openvdb::Coord const& c) {
    auto const place = search.at(c);
    return !place.leaf && place.value == kValue;
  };
  std::vector<Round::Lower const*> nodes;
  tree.getNodes(nodes);
  ASSERT_EQ(nodes.size(), 8u);
  std::size_t inside = 0, all = 0;
  for (Round::Lower const* node : nodes) {
    auto const slots = round.inside(search, *node);
    for (unsigned slot = 0; slot < 4096; ++slot) {
      openvdb::Coord local;
      Round::Lower::offsetToLocalCoord(slot, local);
      openvdb::Coord const c = (local << 3) + node->origin();
      bool expected = true;
      for (int n = 0; n < 27; ++n)
        expected = expected && isValue(c.offsetBy(8 * (n / 9 - 1), 8 * (n / 3 % 3 - 1), 8 * (n % 3 - 1)));
      bool const told = slots[slot / 64] >> slot % 64 & 1;
      ASSERT_EQ(told, expected) << c;
      inside += told, ++all;
    }
  }
  EXPECT_GT(inside, all / 4);
  EXPECT_LT(inside, all);
}

} // namespace
