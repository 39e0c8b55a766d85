// Many elements written or read in one call, in the orders that callers have: the result is that of as many
// single writes or reads.
#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/volume/Volume.h"
#include "support/Print.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cstdlib>
#include <limits>
#include <map>
#include <random>
#include <span>
#include <stdexcept>
#include <string>
#include <tuple>
#include <type_traits>
#include <utility>
#include <vector>

namespace VLN::Test {
namespace {

using namespace VLN::TileTree3D;

constexpr int kLow = -536870912, kHigh = 536870911;

struct Order {
  char const* name;
  std::vector<int3> positions;
};

/// Every position of a box that no tile or block is aligned to, the axis `a` fastest, then `b`.
std::vector<int3> boxOf(int3 const& low, int3 const& size, int a, int b, int step = 1) {
  std::vector<int3> out;
  int const c = 3 - a - b;
  int3 p;
  for (p[c] = low[c]; p[c] < low[c] + size[c]; ++p[c])
    for (p[b] = low[b]; p[b] < low[b] + size[b]; ++p[b])
      for (p[a] = low[a]; p[a] < low[a] + size[a]; p[a] += step) out.push_back(p);
  return out;
}

std::vector<Order> orders() {
  int3 const low{-13, -7, 5}, size{45, 37, 41}; // more than a chunk of positions
  std::vector<Order> all{{"i, j, k", boxOf(low, size, 0, 1)},
                         {"j, k, i", boxOf(low, size, 1, 2)},
                         {"k, j, i", boxOf(low, size, 2, 1)},
                         {"every other i", boxOf(low, size, 0, 2, 2)},
                         {"every third k", boxOf(low, size, 2, 0, 3)}};
  Order backwards{"backwards", boxOf(low, size, 0, 1)};
  std::reverse(backwards.positions.begin(), backwards.positions.end());
  all.push_back(backwards);
  Order twice{"twice", boxOf(low, size, 0, 1)};
  auto const again = boxOf(low, size, 2, 1);
  twice.positions.insert(twice.positions.end(), again.begin(), again.end());
  all.push_back(twice);
  Order shuffled{"shuffled", twice.positions};
  std::shuffle(shuffled.positions.begin(), shuffled.positions.end(), std::mt19937(5));
  all.push_back(shuffled);
  // Rows of all lengths at all places, along all axes, with diagonals and steps back between them.
  Order walks{"walks", {}};
  std::mt19937 random(11);
  for (int3 p{0, 0, 0}; walks.positions.size() < 60000;) {
    auto const axis = static_cast<int>(random() % 3);
    for (auto n = random() % 20; n > 0; --n) {
      walks.positions.push_back(p);
      ++p[axis];
    }
    for (auto n = random() % 6; n > 0; --n) {
      walks.positions.push_back(p);
      for (int a = 0; a < 3; ++a) p[a] += static_cast<int>(random() % 3) - 1;
    }
    for (int a = 0; a < 3; ++a)
      if (std::abs(p[a]) > 30) p[a] = 0;
  }
  all.push_back(walks);
  // More positions of one block in a row than a run holds.
  Order lingering{"lingering", {}};
  for (int n = 0; n < 2000; ++n) lingering.positions.push_back({n * 5 % 8, n * 3 % 8, n % 2});
  all.push_back(lingering);
  // Neighbours in memory that only high bits of their coordinates tell apart.
  Order apart{"far apart", {}};
  for (int n = 0; n < 600; ++n)
    apart.positions.push_back({n % 7 + (n % 3) * (1 << 16), n % 5 + (n % 2) * (1 << 20), (n / 50 % 2) << 24});
  all.push_back(apart);
  // Few to a tile, in more blocks than a chunk remembers; the second half has some that the first has not.
  Order scattered{"scattered", {}};
  for (int n = 0; n < 40000; ++n) {
    int const width = n < 20000 ? 150 : 170;
    auto const next = [&] { return static_cast<int>(random() % static_cast<unsigned>(width)) - 70; };
    int const x = next(), y = next();
    scattered.positions.push_back({x, y, next()});
  }
  all.push_back(scattered);
  // Rows over what was scattered before, but not where that began.
  Order over{"rows over scattered ones", boxOf({2000, 0, 0}, {300, 1, 1}, 0, 1)}; // which begin in order
  for (int n = 0; n < 15000; ++n) {
    auto const next = [&] { return static_cast<int>(random() % 60) + (n < 1200 ? 1000 : 0); };
    int const x = next(), y = next();
    over.positions.push_back({x, y, next()});
  }
  auto const rows = boxOf({0, 0, 0}, {60, 60, 15}, 0, 1);
  over.positions.insert(over.positions.end(), rows.begin(), rows.end());
  all.push_back(over);
  // Chunks that meet within blocks, and write the same elements: each plane comes again half a plane later.
  Order planes{"planes again and again", {}};
  for (int n = 0; n < 12; ++n) {
    auto const plane = boxOf({-30, -30, n / 2 - 1}, {80, 80, 1}, 0, 1);
    planes.positions.insert(planes.positions.end(), plane.begin(), plane.end());
  }
  all.push_back(planes);
  Order ends{"ends of the domain", boxOf({kHigh - 9, kHigh - 2, kLow}, {10, 3, 3}, 0, 1)};
  for (int3 const& p : boxOf({kLow, kLow, kHigh - 20}, {2, 2, 21}, 2, 0)) ends.positions.push_back(p);
  all.push_back(ends);
  return all;
}

template <class T> T valueOf(std::size_t n) {
  auto const v = static_cast<float>(n % 251 + 1);
  if constexpr (std::is_class_v<T>)
    return {v, -v, 2 * v};
  else
    return static_cast<T>(v);
}

template <class T> void expectAsOneByOne(Order const& order, int threads) {
  std::vector<T> values;
  for (std::size_t n = 0; n < order.positions.size(); ++n) values.push_back(valueOf<T>(n));
  std::map<std::tuple<int, int, int>, T> model;
  for (std::size_t n = 0; n < values.size(); ++n) {
    int3 const& p = order.positions[n];
    model[{p.x, p.y, p.z}] = values[n];
  }
  Volume volume;
  T const nothing{};
  auto field = volume.addField<T>("f", nothing);
  auto const write = [&] { VLN::withThreads(threads, [&] { field.set(order.positions, values); }); };
  auto const expectModel = [&](char const* when) {
    for (auto const& [p, value] : model) {
      auto const [x, y, z] = p;
      ASSERT_EQ(field.get(x, y, z), value)
          << order.name << ", " << when << ", " << threads << " threads, " << x << " " << y << " " << z;
    }
    // Whatever else its tiles hold is untouched.
    std::int64_t written = 0;
    for (T const& element : field.channel()) written += !(element == nothing);
    ASSERT_EQ(written, static_cast<std::int64_t>(model.size())) << order.name << ", " << when;
  };
  write();
  expectModel("into nothing");
  // Over half of the tiles, which the tree has by now, and others that are new.
  field.fill(nothing);
  write();
  expectModel("into tiles of the tree");
}

TEST(BulkSetTest, RequirementEveryOrderIsThatOfSingleWrites) {
  for (Order const& order : orders())
    for (int const threads : {1, 2, 3}) {
      expectAsOneByOne<float>(order, threads);
      if (HasFatalFailure()) return;
    }
}

TEST(BulkSetTest, RequirementElementsOfEverySize) {
  for (Order const& order : orders()) {
    expectAsOneByOne<std::uint8_t>(order, 2);
    expectAsOneByOne<float3>(order, 2);
    if (HasFatalFailure()) return;
  }
}

/// Few tiles are made one by one, many together: in the same order for any number of threads.
TEST(BulkSetTest, RequirementTilesAreNumberedTheSameForAnyNumberOfThreads) {
  auto all = orders();
  Order few{"many positions in few tiles", std::vector<int3>(20000, {1, 2, 3})};
  int3 const later[3] = {{4, 0, 4}, {12, 0, 0}, {0, 4, 0}}; // of two blocks in turns
  for (std::size_t n = 0; n < 20000; ++n) few.positions.push_back(later[n % 3]);
  all.push_back(few);
  for (Order const& order : all) {
    std::vector<float> const values(order.positions.size(), 1.0f);
    std::vector<int3> first;
    for (int const threads : {1, 2, 3, 8}) {
      Volume volume;
      auto field = volume.addField<float>("f", 0);
      VLN::withThreads(threads, [&] { field.set(order.positions, values); });
      std::vector<int3> corners;
      for (int d = 0; d <= 28; ++d)
        for (std::int64_t n = 0; n < volume.tree().tileCount(d); ++n)
          corners.push_back(volume.tree().tile(n, d).tijk());
      if (threads == 1) first = corners;
      EXPECT_EQ(corners, first) << order.name << ", " << threads << " threads";
    }
  }
}

TEST(BulkSetTest, RequirementSomeTilesThereAndSomeNot) {
  auto const box = boxOf({-9, -9, -9}, {40, 40, 40}, 0, 1);
  Volume volume;
  auto field = volume.addField<float>("f", 0);
  std::mt19937 random(3);
  for (int n = 0; n < 200; ++n) {
    int3 const& p = box[random() % box.size()];
    field.set(p, 1); // pending tiles, and after n = 100 tiles of the tree too
    if (n == 100) volume.tileCount();
  }
  std::vector<float> values;
  for (std::size_t n = 0; n < box.size(); ++n) values.push_back(valueOf<float>(n));
  field.set(box, values);
  for (std::size_t n = 0; n < box.size(); ++n) ASSERT_EQ(field.get(box[n]), values[n]) << n;
  EXPECT_EQ(field.get(-10, -9, -9), 0.0f);
}

/// Many tiles have been made by the time the position beyond is met.
TEST(BulkSetTest, NegativeBeyondTheDomainAfterManyTiles) {
  auto positions = boxOf({-30, -30, -30}, {70, 70, 70}, 2, 0);
  positions.push_back({kHigh + 1, 0, 0});
  std::vector<float> const values(positions.size(), 1.0f);
  for (int const threads : {1, 2, 3}) {
    Volume volume;
    auto field = volume.addField<float>("f", 7);
    field.set(3, 3, 3, 5);
    VLN::withThreads(threads, [&] { EXPECT_THROW(field.set(positions, values), std::out_of_range); });
    EXPECT_EQ(field.get(3, 3, 3), 5.0f);
    field.set(3, 3, 3, 7);
    for (float const& element : field.channel()) ASSERT_EQ(element, 7.0f) << threads << " threads";
    // And the field is sound.
    std::span const inside(positions.data(), positions.size() - 1);
    field.set(inside, std::span(values).first(inside.size()));
    for (int3 const& p : inside) ASSERT_EQ(field.get(p), 1.0f) << threads << " threads";
  }
}

/// Blocks that the field has with some of their tiles get others before the position beyond is met, and lose
/// them again.
TEST(BulkSetTest, NegativeBeyondTheDomainAtRandom) {
  auto positions = boxOf({-30, -30, -30}, {70, 70, 70}, 2, 0);
  std::shuffle(positions.begin(), positions.end(), std::mt19937(7));
  std::span const some(positions.data(), 500);
  auto beyond = positions;
  int3 const first{5, kLow - 1, 6};
  beyond.insert(beyond.end() - 1000, {first, {kHigh + 1, 0, 0}, {0, 0, kHigh + 9}, {kHigh + 1, 7, 7}});
  std::vector<float> const ones(beyond.size(), 1.0f);
  for (int const threads : {1, 2, 3})
    VLN::withThreads(threads, [&] {
      Volume volume;
      auto field = volume.addField<float>("f", 7);
      field.set(some, std::vector<float>(some.size(), 5.0f));
      if (threads != 2) volume.tileCount(); // tiles of the tree; pending ones else
      std::string message;
      try {
        field.set(beyond, ones);
      } catch (std::out_of_range const& e) { message = e.what(); }
      EXPECT_EQ(message, "(5, " + std::to_string(first.y) + ", 6) lies outside the domain of a volume");
      std::size_t written = 0;
      for (int3 const& p : positions) written += field.get(p) == 5.0f;
      EXPECT_EQ(written, some.size());
      for (float const& element : field.channel()) ASSERT_TRUE(element == 5.0f || element == 7.0f);
      field.set(positions, std::span(ones).first(positions.size()));
      for (int3 const& p : positions) ASSERT_EQ(field.get(p), 1.0f) << threads << " threads";
      std::size_t ofOne = 0;
      for (float const& element : field.channel()) ofOne += element == 1.0f;
      EXPECT_EQ(ofOne, positions.size());
    });
}

/// The first position that is beyond names itself, wherever in a row it is, and nothing is written.
TEST(BulkSetTest, NegativeRowsThatLeaveTheDomain) {
  constexpr int kMost = std::numeric_limits<int>::max();
  struct Case {
    int3 first;
    int axis;
    int3 outside;
  };
  for (Case const& c :
       {Case{{kHigh - 10, 0, 0}, 0, {kHigh + 1, 0, 0}}, Case{{0, kHigh - 3, 0}, 1, {0, kHigh + 1, 0}},
        Case{{5, 6, kHigh}, 2, {5, 6, kHigh + 1}}, Case{{kLow - 5, 1, 1}, 0, {kLow - 5, 1, 1}},
        Case{{3, kMost - 20, 3}, 1, {3, kMost - 20, 3}}, Case{{1 << 30, 0, 0}, 2, {1 << 30, 0, 0}}}) {
    std::vector<int3> positions(20, c.first);
    for (int n = 0; n < 20; ++n) positions[static_cast<std::size_t>(n)][c.axis] += n;
    positions.push_back({1, 2, 3});
    Volume volume;
    auto field = volume.addField<float>("f", 0);
    std::string message;
    try {
      field.set(positions, std::vector<float>(positions.size(), 1.0f));
    } catch (std::out_of_range const& e) { message = e.what(); }
    EXPECT_EQ(message, "(" + std::to_string(c.outside.x) + ", " + std::to_string(c.outside.y) + ", " +
                           std::to_string(c.outside.z) + ") lies outside the domain of a volume");
    EXPECT_EQ(field.get(1, 2, 3), 0.0f);
    for (float const& element : field.channel()) EXPECT_EQ(element, 0.0f);
  }
  // A row that ends where ints do and goes on at their other end is none.
  Volume volume;
  auto field = volume.addField<float>("f", 0);
  std::vector<int3> const wrapped{{kMost, 0, 0}, {-kMost - 1, 0, 0}};
  EXPECT_THROW(field.set(wrapped, std::vector<float>(2, 1.0f)), std::out_of_range);
}

/// Half of the positions have tiles of the deepest depth, others coarser ones or none.
template <class T> void expectReadsAsOneByOne(Order const& order, int threads) {
  Volume volume;
  auto field = volume.addField<T>("f", valueOf<T>(250));
  auto const half = std::span(order.positions).first(order.positions.size() / 2);
  std::vector<T> values;
  for (std::size_t n = 0; n < half.size(); ++n) values.push_back(valueOf<T>(n));
  field.set(half, values);
  auto const expectSame = [&](char const* when) {
    std::vector<T> read(order.positions.size(), T{});
    VLN::withThreads(threads, [&] { std::as_const(field).get(order.positions, read); });
    for (std::size_t n = 0; n < read.size(); ++n)
      ASSERT_EQ(read[n], field.get(order.positions[n])) << order.name << ", " << when << ", position " << n;
  };
  expectSame("pending");
  field.editChannel().tileData(TreeIndex{0, PowerOfTwoTraits::kMaxDepth - 1}).set(valueOf<T>(77));
  expectSame("in the tree");
}

TEST(BulkGetTest, RequirementEveryOrderIsThatOfSingleReads) {
  for (Order const& order : orders())
    for (int const threads : {1, 3}) {
      expectReadsAsOneByOne<float>(order, threads);
      if (HasFatalFailure()) return;
    }
}

TEST(BulkGetTest, RequirementElementsOfEverySize) {
  for (Order const& order : orders()) {
    expectReadsAsOneByOne<std::uint8_t>(order, 2);
    expectReadsAsOneByOne<double3>(order, 2);
    if (HasFatalFailure()) return;
  }
}

TEST(BulkGetTest, EdgesNothingToReadAndBeyondTheDomain) {
  Volume volume;
  auto field = volume.addField<float>("f", 3);
  field.get(std::span<int3 const>(), std::span<float>());
  constexpr int kLowest = std::numeric_limits<int>::min(), kTop = std::numeric_limits<int>::max();
  field.set(kLow, kLow, kLow, 1);
  field.set(kHigh, kHigh, kHigh, 2);
  std::vector<int3> const positions{{kLow, kLow, kLow},        {kLow - 1, kLow, kLow}, {kHigh, kHigh, kHigh},
                                    {kHigh, kHigh + 1, kHigh}, {kLowest, 0, kTop},     {kTop, kTop, kTop}};
  std::vector<float> values(positions.size());
  field.get(positions, values);
  EXPECT_EQ(values, (std::vector<float>{1, 3, 2, 3, 3, 3}));
}

TEST(BulkGetTest, NegativeCountsThatDiffer) {
  Volume volume;
  auto field = volume.addField<float>("density", 3);
  std::vector<float> values(2, -1.0f);
  try {
    field.get(std::vector<int3>(3), values);
    FAIL();
  } catch (std::invalid_argument const& e) {
    EXPECT_STREQ(e.what(), "field \"density\": 3 positions with 2 values");
  }
  EXPECT_EQ(values, std::vector<float>(2, -1.0f));
}

} // namespace
} // namespace VLN::Test
