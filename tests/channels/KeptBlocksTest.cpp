// Large blocks behind static tiles wait for the next channel of their size.
#include "FakeTree.h"
#include "GeometryVolume/pools/Jemalloc.h"
#include "ProbeChannel.h"
#include "vljemalloc/vljemalloc.h"

#include <algorithm>
#include <cstdint>
#include <fstream>
#include <gtest/gtest.h>
#include <malloc.h>
#include <memory>
#include <unistd.h>
#include <utility>
#include <vector>

namespace {

using namespace VLN::TileTree3D;
using namespace VLN::Test;

using C = ProbeChannel<PowerOfTwoTraits, float, 4, 0>;
constexpr std::int64_t kMegabyte = 1 << 20;

/// A channel of so many bytes.
std::unique_ptr<C> channelOf(std::int64_t bytes, float value, bool construct = true) {
  auto channel = std::make_unique<C>(Flags{true, construct, false, 3, 3}, value);
  channel->update(FakeTree().set(3, static_cast<std::size_t>(bytes / 256), 64));
  return channel;
}
bool holdsOnly(C const& channel, float value) {
  for (std::int64_t n = 0; n < channel.tileCount(3); ++n) {
    auto const tile = channel.tileData(n, 3);
    if (tile.size() != 64) return false;
    if (!std::all_of(tile.begin(), tile.end(), [&](float v) { return v == value; })) return false;
  }
  return true;
}
/// Bytes of the process that lie in memory, without what the C library holds for later.
std::int64_t residentBytes() {
  malloc_trim(0);
  std::int64_t whole = 0, resident = 0;
  std::ifstream("/proc/self/statm") >> whole >> resident;
  return resident * sysconf(_SC_PAGESIZE);
}

class KeptBlocks : public ::testing::Test {
protected:
  void SetUp() override {
    char const* version = nullptr;
    std::size_t length = sizeof(version);
    if (vlje_mallctl("version", static_cast<void*>(&version), &length, nullptr, 0) != 0)
      GTEST_SKIP() << "with the system back end none waits";
    VLN::jemalloc_flushCache();
  }
  void TearDown() override { VLN::jemalloc_flushCache(); }
};

// Elements that nobody writes show what the block held.
TEST_F(KeptBlocks, RequirementNextChannelOfTheSizeTakesTheBlock) {
  channelOf(12 * kMegabyte, 7.0f);
  EXPECT_TRUE(holdsOnly(*channelOf(12 * kMegabyte, 0.0f, false), 7.0f));
  EXPECT_TRUE(holdsOnly(*channelOf(11 * kMegabyte, 0.0f, false), 7.0f)) << "it is hardly larger";
}

TEST_F(KeptBlocks, RequirementTilesHoldTheDefaultValueOfTheirOwnChannel) {
  for (float const value : {7.0f, 0.0f, -0.0f, 3.0f, 0.0f})
    for (std::int64_t const size : {9, 12, 40, 12})
      EXPECT_TRUE(holdsOnly(*channelOf(size * kMegabyte, value), value)) << value << ", " << size << " MB";
}

TEST_F(KeptBlocks, RequirementBlocksInUseAreNobodyElses) {
  auto const one = channelOf(12 * kMegabyte, 1.0f);
  channelOf(12 * kMegabyte, 2.0f);
  auto const three = channelOf(12 * kMegabyte, 3.0f), four = channelOf(12 * kMegabyte, 4.0f);
  EXPECT_TRUE(holdsOnly(*one, 1.0f));
  EXPECT_TRUE(holdsOnly(*three, 3.0f));
  EXPECT_TRUE(holdsOnly(*four, 4.0f));
}

TEST_F(KeptBlocks, BoundaryLittleWaitsAndNothingAfterAFlush) {
  std::int64_t const before = residentBytes();
  std::vector<std::unique_ptr<C>> channels;
  for (std::int64_t const size : {30, 70, 25, 10, 9, 30, 20})
    channels.push_back(channelOf(size * kMegabyte, 1.0f));
  EXPECT_GT(residentBytes(), before + 190 * kMegabyte);
  channels.clear();
  EXPECT_LT(residentBytes(), before + 80 * kMegabyte);
  EXPECT_GT(residentBytes(), before + 20 * kMegabyte);
  VLN::jemalloc_flushCache();
  EXPECT_LT(residentBytes(), before + 8 * kMegabyte);
}

// A large block of zeros is fresh; it does not stand beside one that waits.
TEST_F(KeptBlocks, BoundaryWhatFitsDoesNotLieIdleBesideZeros) {
  std::int64_t const before = residentBytes();
  channelOf(40 * kMegabyte, 1.0f);
  EXPECT_GT(residentBytes(), before + 30 * kMegabyte);
  auto const zeros = channelOf(40 * kMegabyte, 0.0f);
  EXPECT_LT(residentBytes(), before + 30 * kMegabyte);
  EXPECT_TRUE(holdsOnly(*zeros, 0.0f));
}

} // namespace
