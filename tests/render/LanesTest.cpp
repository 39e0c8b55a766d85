// Four at once as one by one.
#include "Render/Lanes.h"

#include <gtest/gtest.h>

#include <cmath>

namespace VLN::Test {
namespace {

using namespace Render;

// requirement
TEST(Lanes, RequirementDecayIsThatOfTheLibrary) {
  for (int step = 0; step < 23000; ++step) {
    float const x = 0.00371f * static_cast<float>(step); // to 85.3
    float got[4];
    decay(Lanes(x, 0.5f * x, 1e-3f * x, 86 - x)).store(got);
    double const want[4] = {std::exp(-double(x)), std::exp(-0.5 * double(x)), std::exp(-double(1e-3f * x)),
                            std::exp(-double(86 - x))};
    // The product with 1 / ln 2 is off by half a unit in its last place, which grows with x.
    for (int n = 0; n < 4; ++n) ASSERT_NEAR(got[n] / want[n], 1, 1e-5) << x << " " << n;
    ASSERT_NEAR(double(got[2]), want[2], 3e-7);
  }
  EXPECT_EQ(decay(Lanes(0.0f)).first(), 1);
  EXPECT_LT(decay(Lanes(1e30f)).first(), 1e-37f);
  EXPECT_LT(decay(Lanes(INFINITY)).first(), 1e-37f);
}

// requirement
TEST(Lanes, RequirementGoWhereTheyAreSent) {
  float const p[] = {1, 2, 3, 4}, q[] = {5, 6, 7, 8};
  Lanes const pairs = Lanes::pairs(p + 1, q + 2);
  float got[4];
  pairs.store(got);
  EXPECT_EQ(got[0] * 1000 + got[1] * 100 + got[2] * 10 + got[3], 2378);
  evens(Lanes::load(p), Lanes::load(q)).store(got);
  EXPECT_EQ(got[0] * 1000 + got[1] * 100 + got[2] * 10 + got[3], 1357);
  odds(Lanes::load(p), Lanes::load(q)).store(got);
  EXPECT_EQ(got[0] * 1000 + got[1] * 100 + got[2] * 10 + got[3], 2468);
  EXPECT_EQ(Lanes::load(p).upper().first(), 3);
  EXPECT_EQ(Lanes::load(p).upper().second(), 4);
  std::int32_t whole[4];
  Lanes(-1.5f, 2.75f, 0, 7).whole(whole).store(got);
  EXPECT_EQ(whole[0], -1);
  EXPECT_EQ(got[1], 2);
  EXPECT_EQ(whole[3], 7);
  EXPECT_EQ(lesser(Lanes(NAN), Lanes(2.0f)).first(), 2);
  EXPECT_EQ(larger(Lanes(NAN), Lanes(2.0f)).first(), 2);
}

} // namespace
} // namespace VLN::Test
