// Runs a body under many seeds of src/GeometryVolume/core/YieldPointImpl.h, in builds that have yield points.
#pragma once

#include "GeometryVolume/core/YieldPointImpl.h"

#ifdef VLN_YIELD_POINTS

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <gtest/gtest.h>
#include <random>

namespace Support {

/// `body(seed)` for so many seeds, each of which is printed; with VLN_YIELD_SEED in the environment, for that
/// one alone.
template <class Body> void underYieldSeeds(int count, Body const& body) {
  char const* const given = std::getenv("VLN_YIELD_SEED");
  std::uint64_t const first = given ? std::strtoull(given, nullptr, 10) : std::random_device()() + 1ull;
  std::uint64_t const before = VLN::Internal::yieldCount();
  for (std::uint64_t seed = first; seed < first + (given ? 1 : static_cast<std::uint64_t>(count)); ++seed) {
    SCOPED_TRACE("VLN_YIELD_SEED=" + std::to_string(seed));
    std::fprintf(stderr, "VLN_YIELD_SEED=%llu\n", static_cast<unsigned long long>(seed));
    VLN::Internal::setYieldSeed(seed);
    body(seed);
    VLN::Internal::setYieldSeed(0);
    if (::testing::Test::HasFailure()) return;
  }
  EXPECT_GT(VLN::Internal::yieldCount(), before);
}

} // namespace Support

#endif
