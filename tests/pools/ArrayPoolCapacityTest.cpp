#include "GeometryVolume/pools/ArrayPool.h"

#include <cmath>
#include <cstdint>
#include <gtest/gtest.h>
#include <limits>

namespace {

using VLN::TileTree3D::ArrayPool::capacityFor;

/// Each step in double and then rounded to float: no step can carry more digits than a float has.
std::uint64_t floatByFloat(std::uint64_t n) {
  auto const rounded = [](double value) {
    volatile float f = static_cast<float>(value);
    return static_cast<double>(f);
  };
  double const count = rounded(static_cast<double>(n));
  double const logarithm = rounded(std::log(count));
  double const perOctave = rounded(1.0 / rounded(std::log(2.0)));
  double const octaves = std::ceil(rounded(logarithm * perOctave));
  return static_cast<std::uint64_t>(rounded(std::pow(2.0, octaves)));
}

TEST(ArrayPoolCapacity, RequirementKnownCounts) {
  EXPECT_EQ(capacityFor(0), 0u);
  EXPECT_EQ(capacityFor(1), 1u);
  EXPECT_EQ(capacityFor(2), 2u);
  EXPECT_EQ(capacityFor(5), 8u);
  EXPECT_EQ(capacityFor(8), 8u);
  EXPECT_EQ(capacityFor(10), 16u);
  EXPECT_EQ(capacityFor(64), 64u);
  EXPECT_EQ(capacityFor(1000), 1024u);
}

TEST(ArrayPoolCapacity, RequirementEveryCountUpToTwoToThe22) {
  std::uint64_t wrong = 0, below = 0, firstBelow = 0;
  for (std::uint64_t n = 0; n <= std::uint64_t(1) << 22; ++n) {
    std::uint64_t const c = capacityFor(n);
    if (c != floatByFloat(n)) {
      if (++wrong <= 5) ADD_FAILURE() << "count " << n << ": " << c << " instead of " << floatByFloat(n);
    }
    if (c < n && ++below == 1) firstBelow = n;
    ASSERT_EQ(c & (c - 1), 0u) << "count " << n << ": " << c << " is no power of two";
    ASSERT_LE(c, 4 * n) << "count " << n;
  }
  EXPECT_EQ(wrong, 0u);
  RecordProperty("counts_above_their_capacity", static_cast<int>(below));
  EXPECT_GT(firstBelow, std::uint64_t(1) << 21) << below << " counts get too little";
}

TEST(ArrayPoolCapacity, BoundaryTheLargestCountStaysItself) {
  auto const most = std::numeric_limits<std::uint64_t>::max();
  EXPECT_EQ(capacityFor(most), most);
  EXPECT_EQ(capacityFor(std::uint64_t(1) << 62), std::uint64_t(1) << 62);
}

} // namespace
