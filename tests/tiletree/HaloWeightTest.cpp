// The 261 weights of compressed halos, recomputed from the rule of their order.
#include "GeometryVolume/tiletree/HaloWeights.h"

#include <gtest/gtest.h>

#include <cmath>
#include <numeric>
#include <set>
#include <vector>

using namespace VLN::TileTree3D;

namespace {

/// A reduced fraction, ordered by denominator and then by numerator.
struct Fraction {
  long denominator, numerator;
  Fraction(long n, long d)
      : denominator(d / std::gcd(n, d))
      , numerator(n / std::gcd(n, d)) {}
  bool operator<(Fraction const& b) const {
    return denominator != b.denominator ? denominator < b.denominator : numerator < b.numerator;
  }
  bool operator==(Fraction const&) const = default;
  double value() const { return static_cast<double>(numerator) / static_cast<double>(denominator); }
};

void addProducts(std::set<Fraction>& set, std::vector<long> const& factors, long denominator) {
  for (long a : factors) {
    for (long b : factors) {
      for (long c : factors) set.insert(Fraction(a * b * c, denominator * denominator * denominator));
    }
  }
}

std::vector<Fraction> expectedOrder() {
  std::vector<Fraction> table = {{1, 4}, {1, 8}, {1, 2}, {1, 16}, {1, 1}, {1, 32}, {3, 16}, {3, 32}};
  Fraction const last(175, 1024);
  std::set<Fraction> readable;
  for (long level = 1; level <= 3; ++level) {
    long const width = 1L << level; // fine samples in a coarse one
    std::vector<long> corner, centred;
    for (long j = 1; j <= width; ++j) corner.push_back(j);
    for (long j = 1; j < 2 * width; j += 2) centred.push_back(j);
    addProducts(readable, corner, width);
    addProducts(readable, centred, 2 * width);
  }
  std::set<Fraction> simple;
  std::vector<long> sixteen(16);
  std::iota(sixteen.begin(), sixteen.end(), 1L);
  addProducts(simple, sixteen, 16);
  std::set<Fraction> taken(table.begin(), table.end());
  taken.insert(last);
  for (auto const* source : {&readable, &simple}) {
    for (Fraction const& f : *source) {
      if (table.size() < 260 && taken.insert(f).second) table.push_back(f);
    }
  }
  table.push_back(last);
  return table;
}

} // namespace

// requirement
TEST(HaloWeights, BeginAndEndAsGiven) {
  auto const& w = haloWeights();
  ASSERT_EQ(w.size(), 261u);
  float const first[] = {0.25f, 0.125f, 0.5f, 0.0625f, 1.0f, 0.03125f, 0.1875f, 0.09375f};
  for (std::size_t n = 0; n < 8; ++n) EXPECT_EQ(w[n], first[n]) << n;
  EXPECT_EQ(w.back(), 175.0f / 1024.0f);
  EXPECT_NEAR(w.back(), 0.170898, 5e-7);
}

// requirement
TEST(HaloWeights, AreDistinctAndExact) {
  auto const& w = haloWeights();
  EXPECT_EQ((std::set<float>{w.begin(), w.end()}).size(), w.size());
  for (float v : w) {
    EXPECT_GT(v, 0.0f);
    EXPECT_LE(v, 1.0f);
    EXPECT_EQ(v * 4096.0f, std::floor(v * 4096.0f)) << v << " is a whole number of 1/4096";
  }
}

// requirement
TEST(HaloWeights, FollowTheRuleOfTheirOrder) {
  auto const& w = haloWeights();
  auto const expected = expectedOrder();
  ASSERT_EQ(expected.size(), w.size());
  for (std::size_t n = 0; n < w.size(); ++n)
    ASSERT_EQ(static_cast<double>(w[n]), expected[n].value())
        << n << ": " << expected[n].numerator << '/' << expected[n].denominator;
}

// requirement: what a read at a whole sample position can give is in the table
TEST(HaloWeights, HoldEveryProductOfCornerReadsUpToThreeLevels) {
  auto const& w = haloWeights();
  std::set<float> const all(w.begin(), w.end());
  for (int level = 1; level <= 3; ++level) {
    int const width = 1 << level;
    for (int a = 1; a <= width; ++a) {
      for (int b = 1; b <= width; ++b) {
        for (int c = 1; c <= width; ++c)
          EXPECT_EQ(all.count(static_cast<float>(a * b * c) / static_cast<float>(width * width * width)), 1u)
              << a << ' ' << b << ' ' << c << " / " << width;
      }
    }
  }
}

// requirement
TEST(HaloWeights, NearestIsTheClosestAndTheEarlierOnATie) {
  auto const& w = haloWeights();
  for (int n = 0; n < kHaloWeightCount; ++n) EXPECT_EQ(nearestHaloWeight(w[static_cast<std::size_t>(n)]), n);
  for (int n = -10; n <= 1010; ++n) {
    float const asked = static_cast<float>(n) / 997.0f;
    int best = 0;
    for (int i = 1; i < kHaloWeightCount; ++i) {
      auto const distance = [&](int at) { return std::abs(double(w[static_cast<std::size_t>(at)]) - asked); };
      if (distance(i) < distance(best)) best = i;
    }
    EXPECT_EQ(nearestHaloWeight(asked), best) << asked;
  }
  EXPECT_EQ(nearestHaloWeight(100.0f), 4);
}

// requirement: the widths of a packed record's fields
TEST(HaloWeights, ThreeBytesStandBesideTheTable) {
  HaloCompression const table;
  EXPECT_EQ(table.weightBits, 9);
  EXPECT_EQ(table.sameDepthBits, 5);
  EXPECT_EQ(table.coarserBits, 6);
  EXPECT_EQ(table.weights, haloWeights());
}
