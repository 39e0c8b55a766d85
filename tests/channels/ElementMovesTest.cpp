// Elements that move between tiles.
#include "FakeTree.h"
#include "GeometryVolume/core/Parallel.h"
#include "ProbeChannel.h"
#include "UpdateModel.h"

#include <gtest/gtest.h>
#include <random>
#include <sstream>
#include <utility>

namespace {

using namespace VLN;
using namespace VLN::TileTree3D;
using namespace VLN::Test;

using Points = ProbeChannel<PowerOfTwoTraits, int, 4, 0>;

/// Tiles {0,1,2,..}, {100,101,..}, ... at one depth.
Points points(std::vector<int> const& sizes, int depth = 3, bool useStatic = false) {
  Points channel(Flags{useStatic});
  FakeTree tree;
  tree.elements[std::size_t(depth)] = sizes;
  channel.update(tree);
  for (std::int64_t i = 0; i < channel.tileCount(depth); ++i)
    for (int n = 0; n < channel.elementCount(TreeIndex{i, depth}); ++n)
      channel[ElementTreeIndex(i, depth, n)] = int(100 * i) + n;
  return channel;
}
std::vector<int> tile(Points const& channel, std::int64_t i, int depth = 3) {
  auto const data = channel.tileData(i, depth);
  return {data.begin(), data.end()};
}
using Values = std::vector<int>;

class ElementMoves : public ::testing::TestWithParam<bool> {};
INSTANTIATE_TEST_SUITE_P(HeapAndStatic, ElementMoves, ::testing::Bool());

TEST_P(ElementMoves, RequirementArrivalsFollowAndHolesAreFilledFromTheTail) {
  Points channel = points({5, 2, 3}, 3, GetParam());
  std::vector<ElementToFrom> moves = {{1, 0, 1, 3}, {2, 0, 0, 3}, {1, 2, 2, 3}};
  channel.update(moves, 3, false);
  EXPECT_EQ(tile(channel, 0), (Values{4, 3, 2}));
  EXPECT_EQ(tile(channel, 1), (Values{100, 101, 1, 202}));
  EXPECT_EQ(tile(channel, 2), (Values{200, 201, 0}));
}

TEST_P(ElementMoves, RequirementDestinationMinusOneRemovesTheElement) {
  Points channel = points({4, 2}, 3, GetParam());
  std::vector<ElementToFrom> moves = {{-1, 0, 1, 3}, {-2, 1, 0, 3}};
  channel.update(moves, 3, 3, false);
  EXPECT_EQ(tile(channel, 0), (Values{0, 3, 2}));
  EXPECT_EQ(tile(channel, 1), (Values{101}));
}

TEST_P(ElementMoves, RequirementMovedTailElementsArePoppedFirst) {
  Points channel = points({6, 0}, 3, GetParam());
  std::vector<ElementToFrom> moves = {{1, 0, 0, 3}, {1, 0, 4, 3}, {1, 0, 5, 3}};
  channel.update(moves, 3, false);
  EXPECT_EQ(tile(channel, 0), (Values{3, 1, 2}));
  EXPECT_EQ(tile(channel, 1), (Values{0, 4, 5}));
}

TEST_P(ElementMoves, BoundaryAllElementsLeaveAndATileWithoutElementsReceives) {
  Points channel = points({3, 0}, 3, GetParam());
  std::vector<ElementToFrom> moves = {{1, 0, 2, 3}, {1, 0, 1, 3}, {1, 0, 0, 3}};
  channel.update(moves, 3, false);
  EXPECT_TRUE(tile(channel, 0).empty());
  EXPECT_EQ(tile(channel, 1), (Values{0, 1, 2}));
  EXPECT_EQ(channel.tileData(0, 3).data()->capacity(), 0u);
}

TEST_P(ElementMoves, RequirementElementsMoveBetweenDepths) {
  Points channel(Flags{GetParam()});
  FakeTree tree;
  tree.elements[2] = {3};
  tree.elements[5] = {3, 2};
  channel.update(tree);
  for (int n = 0; n < 3; ++n) channel[ElementTreeIndex(0, 2, n)] = 20 + n;
  for (int n = 0; n < 3; ++n) channel[ElementTreeIndex(0, 5, n)] = 50 + n;
  for (int n = 0; n < 2; ++n) channel[ElementTreeIndex(1, 5, n)] = 60 + n;
  TileTree3D::ElementMoves moves(kChannelDepths);
  // Two lists take from the same source tile: positions must be read before anything is removed.
  moves[2] = {{0, 0, 0, 5}, {0, 1, 1, 5}};
  moves[5] = {{1, 0, 2, 5}, {0, 0, 1, 2}};
  channel.update(moves, false);
  // The hole that 21 left is filled from the tail, which by then holds the arrivals.
  EXPECT_EQ(tile(channel, 0, 2), (Values{20, 61, 22, 50}));
  EXPECT_EQ(tile(channel, 0, 5), (Values{21, 51}));
  EXPECT_EQ(tile(channel, 1, 5), (Values{60, 52}));
}

/// Depths 2, 3 and 5 with a tile of three and a tile of two elements each, in a channel that may have fewer.
Points threeDepths(Flags const& flags = {}, std::vector<int> const& deepest = {3, 2}) {
  Points channel(flags);
  FakeTree tree;
  tree.elements[2] = tree.elements[3] = {3, 2};
  tree.elements[5] = deepest;
  channel.update(tree);
  for (int d : {2, 3, 5})
    for (std::int64_t i = 0; i < channel.tileCount(d); ++i)
      for (int n = 0; n < channel.elementCount(TreeIndex{i, d}); ++n)
        channel[ElementTreeIndex(i, d, n)] = 100 * d + int(10 * i) + n;
  return channel;
}
/// One element from the first tile to the second at each depth, one to depth 3 from each of the others and
/// back.
TileTree3D::ElementMoves movesOfAllDepths() {
  TileTree3D::ElementMoves moves(kChannelDepths);
  moves[2] = {{1, 0, 0, 2}, {0, 1, 0, 3}};
  moves[3] = {{1, 0, 1, 2}, {1, 0, 0, 3}, {1, 0, 1, 5}};
  moves[5] = {{0, 1, 1, 3}, {1, 0, 0, 5}};
  return moves;
}

TEST(ElementMovesOutOfRange, RegressionMovesOfDepthsOutsideTheRangeDoNothing) {
  Points const whole = threeDepths();
  auto moves = movesOfAllDepths();
  ElementOrder order;
  DestinationTiles to;
  ArrivalMap arrivals;
  whole.computePermutation(moves, order, to, arrivals, false);
  Points shallow = threeDepths(Flags{.depth = 3}), deep = threeDepths(Flags{.minDepth = 3});
  shallow.updateElements(moves, order, to, arrivals);
  EXPECT_EQ(tile(shallow, 0, 2), (Values{310, 202}));
  EXPECT_EQ(tile(shallow, 1, 2), (Values{210, 211, 200}));
  EXPECT_EQ(tile(shallow, 0, 3), (Values{302, 301}));
  EXPECT_EQ(tile(shallow, 1, 3), (Values{300, 311, 201}))
      << "311 wanted to leave for a depth that is not there";
  EXPECT_EQ(shallow.tileCount(5), 0);
  deep.updateElements(moves, order, to, arrivals);
  EXPECT_EQ(deep.tileCount(2), 0);
  EXPECT_EQ(tile(deep, 0, 3), (Values{302, 301}));
  EXPECT_EQ(tile(deep, 1, 3), (Values{310, 501, 300})) << "310 wanted to leave for a depth that is not there";
  EXPECT_EQ(tile(deep, 0, 5), (Values{311, 502}));
  EXPECT_EQ(tile(deep, 1, 5), (Values{510, 511, 500}));
}

TEST(ElementMovesOutOfRange, RegressionMovesOfTilesThatAreNotThereDoNothing) {
  Points const whole = threeDepths();
  auto moves = movesOfAllDepths();
  ElementOrder order;
  DestinationTiles to;
  ArrivalMap arrivals;
  whole.computePermutation(moves, order, to, arrivals, false);
  Points behind = threeDepths({}, {3}), empty = threeDepths({}, {});
  behind.updateElements(moves, order, to, arrivals);
  EXPECT_EQ(tile(behind, 0, 5), (Values{500, 311, 502}))
      << "500 wanted to leave for a tile that is not there";
  EXPECT_EQ(behind.tileCount(5), 1);
  empty.updateElements(moves, order, to, arrivals);
  EXPECT_EQ(empty.tileCount(5), 0);
  EXPECT_EQ(tile(empty, 0, 3), (Values{302, 301}));
  // A list that names tiles, elements and depths that nobody has.
  std::vector<ElementToFrom> wild = {{7, 0, 0, 3},  {1, 9, 0, 3},  {1, 0, 8, 3}, {1, 0, 0, 28},
                                     {1, 0, 0, -1}, {1, 0, 0, -9}, {1, 0, 0, 3}};
  Points channel = threeDepths();
  channel.update(wild, 3, false);
  EXPECT_EQ(tile(channel, 0, 3), (Values{302, 301}));
  EXPECT_EQ(tile(channel, 1, 3), (Values{310, 311, 300}));
}

TEST(ElementMovesOutOfRange, RegressionARecordOfMovesThatCannotBeFollowed) {
  Points channel = threeDepths(Flags{.depth = 3});
  TileTree3D::TileDataElementAccessor record;
  record.move(ElementTreeIndex(0, 3, 0), TreeIndex{1, 5});
  record.move(ElementTreeIndex(0, 3, 1), TreeIndex{1, 3});
  record.move(ElementTreeIndex(0, 5, 0), TreeIndex{1, 3});
  record.remove(ElementTreeIndex(0, 3, 2));
  record.remove(ElementTreeIndex(0, 5, 2));
  record.remove(ElementTreeIndex(9, 2, 0));
  channel.update(record);
  EXPECT_EQ(tile(channel, 0, 3), (Values{300}));
  EXPECT_EQ(tile(channel, 1, 3), (Values{310, 311, 301}));
  EXPECT_EQ(tile(channel, 0, 2), (Values{200, 201, 202}));
}

template <int E, int H> void expectFixedSizeIsPassedOver() {
  ProbeChannel<PowerOfTwoTraits, int, E, H> channel(Flags{});
  channel.update(FakeTree().set(3, 2, 1));
  for (std::int64_t i = 0; i < 2; ++i) channel.tileData(i, 3).set(int(i));
  std::vector<ElementToFrom> moves = {{1, 0, 0, 3}, {-1, 1, 5, 3}};
  channel.update(moves, 3, false);
  TileTree3D::TileDataElementAccessor record;
  record.move(ElementTreeIndex(0, 3, 0), TreeIndex{1, 3});
  record.remove(ElementTreeIndex(1, 3, 0));
  channel.update(record);
  for (std::int64_t i = 0; i < 2; ++i) {
    EXPECT_EQ(channel.elementCount(TreeIndex{i, 3}), channel.kSize);
    for (int const v : std::as_const(channel).tileData(i, 3)) EXPECT_EQ(v, int(i));
  }
}
TEST(ElementMovesOutOfRange, RegressionChannelsOfFixedSizeArePassedOver) {
  expectFixedSizeIsPassedOver<4, 1>();
  expectFixedSizeIsPassedOver<4, 2>();
  expectFixedSizeIsPassedOver<5, 0>();
}

/// Moves within a depth, each source once, take one pass over each tile; recorded ones grow, copy and remove.
/// Both end with the same elements in the same order.
TEST_P(ElementMoves, RequirementOnePassEndsAsGrowingCopyingAndRemovingDo) {
  for (unsigned const stay : {0u, 1u, 5u, 9u}) {
    for (unsigned seed = 1; seed <= 20; ++seed) {
      SCOPED_TRACE("seed " + std::to_string(seed) + ", " + std::to_string(stay) + " of 10 stay");
      std::mt19937 random(seed);
      std::vector<int> sizes(1 + random() % 40);
      for (int& n : sizes) n = random() % 4 == 0 ? 0 : static_cast<int>(random() % 20);
      // Few destinations, so that some tiles receive much and others nothing.
      auto const destinations = 1 + random() % sizes.size();
      Points once = points(sizes, 3, GetParam()), recorded = points(sizes, 3, GetParam());
      std::vector<ElementToFrom> moves;
      TileDataElementAccessor record;
      for (std::size_t i = 0; i < sizes.size(); ++i) {
        for (int n = 0; n < sizes[i]; ++n) {
          if (random() % 10 < stay) continue;
          auto const to = static_cast<std::int64_t>(random() % (destinations + 1)) - 1;
          ElementTreeIndex const from(static_cast<std::int64_t>(i), 3, n);
          moves.push_back({to, from.index, n, 3});
          if (to < 0)
            record.remove(from);
          else
            record.move(from, TreeIndex{to, 3});
        }
      }
      once.update(moves, 3, true);
      recorded.update(record);
      for (std::int64_t i = 0; i < once.tileCount(3); ++i) {
        ASSERT_EQ(tile(once, i), tile(recorded, i)) << "tile " << i;
        EXPECT_LE(once.tileData(i, 3).data()->capacity(), recorded.tileData(i, 3).data()->capacity() * 2);
      }
    }
  }
}

TEST_P(ElementMoves, RequirementTilesThatExchangeElementsKeepTheirRoom) {
  Points channel = points({8, 8}, 3, GetParam());
  std::vector<ElementToFrom> moves;
  for (std::int64_t i = 0; i < 2; ++i)
    for (int n = 0; n < 8; ++n) moves.push_back({1 - i, i, n, 3});
  int const* const before[] = {channel.tileData(0, 3).data()->data(), channel.tileData(1, 3).data()->data()};
  channel.update(moves, 3, true);
  EXPECT_EQ(tile(channel, 0), (Values{107, 106, 105, 104, 103, 102, 101, 100}));
  EXPECT_EQ(tile(channel, 1), (Values{7, 6, 5, 4, 3, 2, 1, 0}));
  for (std::int64_t i = 0; i < 2; ++i) {
    EXPECT_EQ(channel.tileData(i, 3).data()->data(), before[i]);
    EXPECT_EQ(channel.tileData(i, 3).data()->capacity(), 8u);
    EXPECT_EQ(channel.isStatic(TreeIndex{i, 3}), GetParam());
  }
}

/// A source that is listed twice is copied twice and leaves once, sorted or not.
TEST_P(ElementMoves, BoundaryASourceListedTwice) {
  Points channel = points({4, 1, 1}, 3, GetParam());
  std::vector<ElementToFrom> moves = {{1, 0, 1, 3}, {2, 0, 1, 3}, {2, 0, 3, 3}};
  channel.update(moves, 3, true);
  EXPECT_EQ(tile(channel, 0), (Values{0, 2}));
  EXPECT_EQ(tile(channel, 1), (Values{100, 1}));
  EXPECT_EQ(tile(channel, 2), (Values{200, 1, 3}));
}

TEST_P(ElementMoves, RequirementACopyThatSharesTheStorageKeepsItsElements) {
  Points channel = points({5, 2, 3}, 3, GetParam());
  Points const copy = channel;
  std::vector<ElementToFrom> moves = {{1, 0, 1, 3}, {2, 0, 4, 3}, {-1, 2, 0, 3}};
  channel.update(moves, 3, true);
  EXPECT_EQ(tile(copy, 0), (Values{0, 1, 2, 3, 4}));
  EXPECT_EQ(tile(copy, 2), (Values{200, 201, 202}));
  EXPECT_EQ(tile(channel, 0), (Values{0, 3, 2}));
  EXPECT_EQ(tile(channel, 1), (Values{100, 101, 1}));
  EXPECT_EQ(tile(channel, 2), (Values{4, 201, 202}));
}

TEST(ElementMovesPreparation, RequirementOrderTilesAndArrivals) {
  Points const channel = points({5, 2, 3});
  std::vector<ElementToFrom> moves = {{2, 1, 0, 3}, {0, 2, 1, 3}, {-1, 0, 2, 3}, {2, 0, 1, 3}};
  std::vector<std::uint64_t> order, tiles;
  TileArrivals arrivals;
  channel.computePermutation(moves, order, tiles, arrivals, 3, false);
  EXPECT_EQ(moves, (std::vector<ElementToFrom>{{2, 0, 1, 3}, {-1, 0, 2, 3}, {2, 1, 0, 3}, {0, 2, 1, 3}}));
  EXPECT_EQ(order, (std::vector<std::uint64_t>{1, 3, 0, 2}));
  EXPECT_EQ(tiles, (std::vector<std::uint64_t>{0, 2}));
  EXPECT_EQ(arrivals, (TileArrivals{{0, {1, 5}}, {2, {2, 3}}}));
}

TEST(ElementMovesPreparation, BoundaryNoMoves) {
  Points channel = points({5, 2});
  std::vector<ElementToFrom> moves;
  channel.update(moves, 3, false);
  EXPECT_EQ(tile(channel, 0).size(), 5u);
  TileTree3D::ElementMoves lists;
  channel.update(lists, false);
  EXPECT_EQ(tile(channel, 0).size(), 5u);
}

TEST(ElementMovesPreparation, RequirementAllocateElementStorageGrowsByTheRuns) {
  Points channel = points({5, 2, 3});
  channel.allocateElementStorage({0, 2}, {{0, {1, 5}}, {2, {2, 3}}}, 4, 3);
  EXPECT_EQ(channel.elementCount(TreeIndex{0, 3}), 6);
  EXPECT_EQ(channel.elementCount(TreeIndex{1, 3}), 2);
  EXPECT_EQ(channel.elementCount(TreeIndex{2, 3}), 5);
}

TEST(ElementMovesPreparation, RequirementPermutationKindsReadTheSame) {
  std::vector<ElementToFrom> const list = {{1, 0, 1, 3}, {2, 0, 0, 3}, {-1, 2, 2, 3}};
  auto const prepared = [&](auto const& apply) {
    Points channel = points({5, 2, 3});
    std::vector<ElementToFrom> moves = list;
    std::vector<std::uint64_t> order, tiles;
    TileArrivals arrivals;
    channel.computePermutation(moves, order, tiles, arrivals, 3, false);
    TileTree3D::ElementMoves allMoves(4);
    ElementOrder allOrders(4);
    DestinationTiles allTiles(4);
    ArrivalMap allArrivals(4);
    allMoves[3] = moves, allOrders[3] = order, allTiles[3] = tiles, allArrivals[3] = arrivals;
    ElementRemovals removals(4);
    removals[3] = {{0, 0}, {0, 1}, {2, 2}};
    apply(channel, Permutation<PowerOfTwoTraits>(moves, order, tiles, arrivals, 3, 3),
          Permutation<PowerOfTwoTraits>(allMoves, allOrders, allTiles, allArrivals),
          Permutation<PowerOfTwoTraits>(allMoves, allOrders, allTiles, allArrivals, removals));
    std::vector<Values> result;
    for (std::int64_t i = 0; i < 3; ++i) result.push_back(tile(channel, i));
    return result;
  };
  auto const one =
      prepared([](Points& c, auto const& p, auto const&, auto const&) { c.updateElementsNoDispatch(p); });
  auto const all =
      prepared([](Points& c, auto const&, auto const& p, auto const&) { c.updateElementsNoDispatch(p); });
  auto const recorded =
      prepared([](Points& c, auto const&, auto const&, auto const& p) { c.updateElementsNoDispatch(p); });
  EXPECT_EQ(one, (std::vector<Values>{{4, 3, 2}, {100, 101, 1}, {200, 201, 0}}));
  EXPECT_EQ(all, one);
  EXPECT_EQ(recorded, one);
}

TEST(TileDataElementAccessor, RequirementRecordsAndApplies) {
  Points channel = points({4, 1});
  TileDataElementAccessor a, b;
  a.move(ElementTreeIndex(0, 3, 2), TreeIndex{1, 3});
  b.remove(ElementTreeIndex(0, 3, 0));
  EXPECT_TRUE(b.elementsTo()[3].empty());
  b.move(ElementTreeIndex(0, 3, 1), TreeIndex{1, 3});
  a.join(b);
  EXPECT_EQ(a.elementsTo()[3], (std::vector<ElementToFrom>{{1, 0, 2, 3}, {1, 0, 1, 3}}));
  EXPECT_EQ(a.elementsFrom()[3], (std::vector<ElementInTile>{{0, 2}, {0, 0}, {0, 1}}));
  std::ostringstream os;
  a.dump(os);
  EXPECT_NE(os.str().find("m_elementsTo[3].size() = 2\n"), std::string::npos);
  EXPECT_NE(os.str().find("m_elementsFrom[3].size() = 3\n"), std::string::npos);
  EXPECT_LT(os.str().find("m_elementsTo[28]"), os.str().find("m_elementsFrom[0]"));
  channel.update(a);
  EXPECT_EQ(tile(channel, 0), (Values{3}));
  EXPECT_EQ(tile(channel, 1), (Values{100, 1, 2}));
}

TEST(TileDataElementAccessor, BoundaryRemovalAloneShrinksTheTileByOne) {
  Points channel = points({4});
  TileDataElementAccessor a;
  a.remove(ElementTreeIndex(0, 3, 3));
  channel.update(a);
  EXPECT_EQ(tile(channel, 0), (Values{0, 1, 2}));
}

/// Many random moves at 1, 2 and 8 threads: the same bytes.
TEST(ElementMovesThreads, RequirementResultDoesNotDependOnTheNumberOfThreads) {
  auto const run = [](int threads) {
    std::mt19937 random(77);
    std::vector<int> sizes(300);
    for (int& n : sizes) n = int(random() % 60);
    Points channel = points(sizes);
    std::vector<ElementToFrom> moves;
    for (std::size_t i = 0; i < sizes.size(); ++i)
      for (int n = 0; n < sizes[i]; ++n)
        if (random() % 3 == 0) moves.push_back({int(random() % 310) - 10, std::int64_t(i), n, 3});
    for (auto& move : moves)
      if (move.to < 0) move.to = -1;
    std::shuffle(moves.begin(), moves.end(), random);
    withThreads(threads, [&] { channel.update(moves, 3, false); });
    std::vector<Values> result;
    for (std::int64_t i = 0; i < channel.tileCount(3); ++i) result.push_back(tile(channel, i));
    return result;
  };
  auto const one = run(1);
  EXPECT_EQ(run(2), one);
  EXPECT_EQ(run(8), one);
}

/// Below 500 records lists are sorted serially, from there on in parallel; and destinations are counted where
/// they are few, sorted where they are many. All ways give what a map of vectors gives.
TEST(ElementMovesThreads, BoundaryBothSidesOfTheParallelSort) {
  for (int const records : {1, 498, 499, 500, 501, 1200}) {
    for (int const tiles : {40, 20000}) {
      for (bool const recorded : {false, true}) {
        SCOPED_TRACE(std::to_string(records) + " records, " + std::to_string(tiles) + " tiles" +
                     (recorded ? ", recorded" : ""));
        std::mt19937 random(static_cast<unsigned>(records + tiles));
        std::vector<int> sizes(static_cast<std::size_t>(tiles));
        for (int& n : sizes) n = static_cast<int>(random() % (tiles == 40 ? 80u : 4u));
        Points channel = points(sizes);
        UpdateModel<int> model;
        model.layout = Points::kLayout;
        FakeTree tree;
        tree.elements[3] = sizes;
        model.resizeTiles(tree);
        std::vector<std::pair<std::int64_t, int>> all;
        for (std::int64_t i = 0; i < tiles; ++i) {
          for (int n = 0; n < sizes[static_cast<std::size_t>(i)]; ++n) {
            all.emplace_back(i, n);
            model.tiles[3][static_cast<std::size_t>(i)][static_cast<std::size_t>(n)] = int(100 * i) + n;
          }
        }
        std::shuffle(all.begin(), all.end(), random);
        ASSERT_GE(all.size(), static_cast<std::size_t>(records));
        all.resize(static_cast<std::size_t>(records));
        TileTree3D::ElementMoves moves(kChannelDepths);
        TileDataElementAccessor accessor;
        for (auto const& [tile, element] : all) {
          bool const goes = random() % 7 == 0;
          auto const to = goes ? -1 : static_cast<std::int64_t>(random() % static_cast<unsigned>(tiles));
          moves[3].push_back({to, tile, element, 3});
          ElementTreeIndex const from(tile, 3, element);
          if (goes)
            accessor.remove(from);
          else
            accessor.move(from, TreeIndex{to, 3});
        }
        model.move(moves);
        withThreads(2, [&] {
          if (recorded)
            channel.update(accessor);
          else
            channel.update(moves, false);
        });
        EXPECT_EQ(difference(std::as_const(channel), model), "");
      }
    }
  }
}

} // namespace
