// Places of many positions, by every way that this processor has, beside those told one by one.
#include "GeometryVolume/channels/PartPlacesImpl.h"

#include <gtest/gtest.h>

#include <limits>
#include <random>
#include <vector>

namespace VLN::TileTree3D::Internal {
namespace {

using Velorn::Math::int3;

std::vector<FindPlaces> ways() {
  std::vector<FindPlaces> list{NarrowPlaces::find};
#if VLN_HAS_WIDE_LANES
  if (WidePlaces::isThere()) list.push_back(WidePlaces::find);
#endif
  return list;
}

int bits(int c, int mask) { return static_cast<int>(static_cast<unsigned>(c) & static_cast<unsigned>(mask)); }
bool inOneBlock(int3 const& a, int3 const& b) {
  return bits(a.x, ~7) == bits(b.x, ~7) && bits(a.y, ~7) == bits(b.y, ~7) && bits(a.z, ~7) == bits(b.z, ~7);
}
/// Bits 0, 1 and 2 of a slot are those of the axes.
int slotOf(int3 const& p) { return bits(p.x, 4) / 4 + bits(p.y, 4) / 2 + bits(p.z, 4); }
int elementOf(int3 const& p) { return bits(p.x, 3) + 4 * bits(p.y, 3) + 16 * bits(p.z, 3); }

void expectPlaces(std::vector<int3> const& positions) {
  for (FindPlaces const way : ways()) {
    PartPlaces part(way);
    std::vector<BulkPlace> places(positions.size());
    part.find(positions.data(), positions.size(), places.data(), {0, 0});
    std::uint32_t const* start = part.runStarts();
    for (std::size_t n = 0; n < positions.size(); ++n) {
      ASSERT_EQ(places[n].slot, slotOf(positions[n])) << n;
      ASSERT_EQ(places[n].element, elementOf(positions[n])) << n;
      if (n == 0 || !inOneBlock(positions[n - 1], positions[n])) {
        ASSERT_EQ(*start, n);
        ++start;
      }
    }
    ASSERT_EQ(*start, positions.size());
    for (std::uint32_t const* run = part.runStarts(); *run < positions.size(); ++run) {
      std::uint32_t slots = 0;
      for (std::uint32_t n = run[0]; n < run[1]; ++n) slots |= 1u << slotOf(positions[n]);
      ASSERT_EQ(part.slotsOf(run[0], run[1] - run[0]).bits(), slots) << "run at " << *run;
    }
  }
}

TEST(EightPlaces, OfPositionsFarApart) {
  std::mt19937 random(3);
  constexpr int kLow = std::numeric_limits<int>::min(), kHigh = std::numeric_limits<int>::max();
  std::uniform_int_distribution<int> anywhere(kLow, kHigh);
  for (std::size_t count : {1, 2, 7, 8, 9, 63, 64, 65, 500, 1023, 1024}) {
    SCOPED_TRACE(count);
    std::vector<int3> positions(count);
    for (int3& p : positions) p = {anywhere(random), anywhere(random), anywhere(random)};
    expectPlaces(positions);
  }
  expectPlaces({{kLow, kHigh, 0}, {kLow, kHigh, -1}, {kHigh, kLow, -1}, {kHigh - 7, kLow + 7, -8}});
}

TEST(EightPlaces, OfWalksThroughBlocks) {
  std::mt19937 random(5);
  for (int walk = 0; walk < 300; ++walk) {
    SCOPED_TRACE(walk);
    auto const upTo = [&](int most) { return static_cast<int>(random() % static_cast<unsigned>(most + 1)); };
    std::vector<int3> positions(1 + random() % 1024);
    int3 p{upTo(200) - 100, upTo(200) - 100, upTo(200) - 100};
    int const stay = walk % 7; // steps without a turn, so that runs of all lengths come
    int3 step{1, 0, 0};
    for (std::size_t n = 0; n < positions.size(); ++n) {
      positions[n] = p;
      if (upTo(stay) == 0) step = {upTo(2) - 1, upTo(2) - 1, upTo(2) - 1};
      p = p + step;
    }
    expectPlaces(positions);
  }
}

} // namespace
} // namespace VLN::TileTree3D::Internal
