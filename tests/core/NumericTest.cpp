// Conversions and whole-number helpers.
#include "GeometryVolume/core/Numeric.h"
#include "GeometryVolume/core/FunctionRef.h"

#include <gtest/gtest.h>

#include <limits>

using namespace VLN;

// boundary
TEST(Numeric, ToIntFloorAnswersOutOfDomainForWhatNoIntHolds) {
  EXPECT_EQ(toIntFloor(1.9f), 1);
  EXPECT_EQ(toIntFloor(-1.1f), -2);
  EXPECT_EQ(toIntFloor(-0.0), 0);
  EXPECT_EQ(toIntFloor(2147483647.5), 2147483647);
  EXPECT_EQ(toIntFloor(-2147483648.0), std::numeric_limits<int>::min());
  for (double v : {2147483648.0, -2147483649.0, 1e300, -1e300, std::numeric_limits<double>::infinity(),
                   -std::numeric_limits<double>::infinity(), std::numeric_limits<double>::quiet_NaN()}) {
    EXPECT_EQ(toIntFloor(v), kOutOfDomain) << v;
    EXPECT_EQ(toIntFloor(static_cast<float>(v)), kOutOfDomain) << v;
  }
  EXPECT_EQ(toIntFloor(2147483520.0f), 2147483520) << "the largest float below 2^31";
}

// boundary
TEST(Numeric, CubeRootsAreExact) {
  for (std::uint64_t r : {0ull, 1ull, 2ull, 3ull, 10ull, 1000ull, 2097151ull, 2642244ull, 2642245ull}) {
    EXPECT_EQ(cubeRootFloor(r * r * r), r);
    if (r > 1) { EXPECT_EQ(cubeRootFloor(r * r * r - 1), r - 1); }
    if (r > 0 && r < 2642245) { EXPECT_EQ(cubeRootFloor(r * r * r + 1), r); }
  }
  EXPECT_EQ(cubeRootFloor(std::numeric_limits<std::uint64_t>::max()), 2642245u);
}

// requirement
TEST(Numeric, RoundUpGoesToTheNextMultiple) {
  EXPECT_EQ(roundUp(0, 16), 0u);
  EXPECT_EQ(roundUp(1, 16), 16u);
  EXPECT_EQ(roundUp(16, 16), 16u);
  EXPECT_EQ(roundUp(17, 16), 32u);
}

// requirement
TEST(FunctionRef, CallsTheCallableInPlace) {
  int calls = 0;
  auto body = [&calls](int by) { return calls += by; };
  FunctionRef<int(int)> const ref(body);
  EXPECT_EQ(ref(2), 2);
  EXPECT_EQ(ref(3), 5);
  EXPECT_EQ(calls, 5);
}
