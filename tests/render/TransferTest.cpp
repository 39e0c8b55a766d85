// Opacity as points: what is narrower than a step of the table is not lost.
#include "Render/Transfer.h"

#include <gtest/gtest.h>

namespace VLN::Test {
namespace {

using namespace Render;

Transfer made(std::string const& opacity, bool log = false) {
  TransferOptions options;
  options.low = log ? 0.01f : 0.0f, options.high = 1, options.log = log;
  options.opacity = opacity;
  return Transfer(options);
}
float at(Transfer const& t, float value) { return t.view().opacityAt(t.view().place(value)); }

// regression: a peak between two entries vanished
TEST(Transfer, RegressionNarrowPeaksAreKept) {
  for (bool log : {false, true})
    for (float place : {0.11f, 0.3021f, 0.5003f, 0.77777f}) {
      auto const v = [](float x) { return std::to_string(x); };
      Transfer const t = made(v(place - 1e-4f) + ":0," + v(place) + ":0.75," + v(place + 1e-4f) + ":0", log);
      EXPECT_EQ(t.largestOpacity(0.01f, 1), 0.75f) << place;
      EXPECT_GT(at(t, place), 0.37f) << place;
      EXPECT_EQ(at(t, place + 0.02f), 0) << place << ": no wider than a step to each side";
      EXPECT_EQ(at(t, place - 0.02f), 0) << place;
    }
}

// regression: so did a gap, and a plateau
TEST(Transfer, RegressionNarrowGapsAndPlateausAreKept) {
  Transfer const gap = made("0:0.8,0.3019:0.8,0.302:0.1,0.3021:0.8,1:0.8");
  EXPECT_LT(at(gap, 0.302f), 0.5f);
  EXPECT_EQ(at(gap, 0.31f), 0.8f);
  Transfer const plateau = made("0.3:0,0.30001:0.5,0.30002:0.5,0.30003:0,1:0");
  EXPECT_EQ(plateau.largestOpacity(0, 1), 0.5f);
}

// requirement: what is wide is what it was
TEST(Transfer, RequirementWidePointsAreStraightLines) {
  Transfer const t = made("0:0,0.25:0.5,0.75:0.5,1:1");
  for (int n = 0; n <= 255; ++n) {
    float const v = static_cast<float>(n) / 255;
    EXPECT_NEAR(t.view().opacity[n],
                v < 0.25f   ? 2 * v
                : v < 0.75f ? 0.5f
                            : 0.5f + 2 * (v - 0.75f),
                2.1f / 255);
  }
}

} // namespace
} // namespace VLN::Test
