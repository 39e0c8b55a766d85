#include "GeometryVolume/nanovtt/AlignedHostBuffer.h"
#include "GeometryVolume/nanovtt/GridHandle.h"

#include <gtest/gtest.h>

#include <cstring>
#include <limits>
#include <stdexcept>
#include <string>
#include <thread>
#include <type_traits>
#include <utility>
#include <vector>

namespace {

using nanovtt::AlignedHostBuffer;

bool isAligned(void const* p) { return reinterpret_cast<std::uintptr_t>(p) % 32 == 0; }

std::string refusal(std::uint64_t size, AlignedHostBuffer const& pool) {
  try {
    AlignedHostBuffer::create(size, &pool);
  } catch (std::runtime_error const& error) { return error.what(); }
  return "";
}

TEST(AlignedHostBuffer, RequirementEmptyHasNothing) {
  AlignedHostBuffer buffer;
  EXPECT_TRUE(buffer.empty());
  EXPECT_EQ(buffer.size(), 0u);
  EXPECT_EQ(buffer.data(), nullptr);
  EXPECT_EQ(buffer.pool(), nullptr);
  buffer.clear();
  EXPECT_FALSE(std::is_copy_constructible_v<AlignedHostBuffer>);
  EXPECT_TRUE(std::is_nothrow_move_constructible_v<AlignedHostBuffer>);
}

TEST(AlignedHostBuffer, RequirementWithoutPoolEachMakesItsOwnOfExactlyThatSize) {
  auto a = AlignedHostBuffer::create(100);
  auto b = AlignedHostBuffer::create(64);
  ASSERT_NE(a.pool(), nullptr);
  EXPECT_NE(a.pool(), b.pool());
  EXPECT_EQ(a.size(), 100u);
  EXPECT_EQ(a.pool()->size(), 100u);
  EXPECT_EQ(a.pool()->used(), 100u);
  EXPECT_EQ(a.pool()->bufferCount(), 1u);
  EXPECT_TRUE(a.pool()->isManaged());
  EXPECT_TRUE(isAligned(a.data()));
  EXPECT_TRUE(isAligned(b.data()));
  EXPECT_EQ(b.pool()->size(), 64u);
  std::memset(a.data(), 7, a.size());
  std::memset(b.data(), 7, b.size());
  EXPECT_EQ(refusal(1, a).substr(0, 46), "AlignedHostBuffer::Pool: insufficient memory\n\t");
  // A pool parameter without a pool of its own counts as none.
  AlignedHostBuffer const none;
  EXPECT_EQ(AlignedHostBuffer::create(10, &none).pool()->size(), 10u);
}

TEST(AlignedHostBuffer, BoundaryAPoolIsFilledExactlyAndNotAByteMore) {
  auto const pool = AlignedHostBuffer::createPool(100);
  EXPECT_TRUE(pool.empty());
  auto const a = AlignedHostBuffer::create(64, &pool);
  EXPECT_EQ(refusal(37, pool), "AlignedHostBuffer::Pool: insufficient memory\n"
                               "\tA buffer requested 37 bytes from a pool with 100 bytes of which\n"
                               "\t64 bytes are used by 1 other buffer(s). Pool is internally managed.\n");
  EXPECT_EQ(pool.pool()->used(), 64u) << "a refusal changes nothing";
  EXPECT_EQ(pool.pool()->bufferCount(), 1u);
  auto const b = AlignedHostBuffer::create(36, &a);
  EXPECT_EQ(b.pool(), pool.pool()) << "the pool of any buffer serves";
  EXPECT_EQ(b.data(), a.data() + 64);
  EXPECT_EQ(pool.pool()->bufferCount(), 2u);
  EXPECT_EQ(refusal(1, b), "AlignedHostBuffer::Pool: insufficient memory\n"
                           "\tA buffer requested 1 bytes from a pool with 100 bytes of which\n"
                           "\t100 bytes are used by 2 other buffer(s). Pool is internally managed.\n");
  EXPECT_EQ(AlignedHostBuffer::create(0, &pool).size(), 0u);
}

TEST(AlignedHostBuffer, NegativeRequestsThatWouldWrapAreRefused) {
  auto const pool = AlignedHostBuffer::createPool(100);
  auto const a = AlignedHostBuffer::create(64, &pool);
  EXPECT_NE(refusal(std::numeric_limits<std::uint64_t>::max(), pool), "");
  EXPECT_NE(refusal(std::numeric_limits<std::uint64_t>::max() - 63, pool), "");
  for (std::uint64_t size : {~0ull, ~0ull - 31, ~0ull - 32, ~0ull / 2}) {
    try {
      AlignedHostBuffer::create(size);
      ADD_FAILURE() << size;
    } catch (std::runtime_error const& error) {
      EXPECT_STREQ(error.what(), "Pool::Pool malloc failed") << size;
    }
  }
}

TEST(AlignedHostBuffer, RequirementMovesKeepTheCountAndClearLowersIt) {
  auto const pool = AlignedHostBuffer::createPool(256);
  auto a = AlignedHostBuffer::create(32, &pool);
  auto b = AlignedHostBuffer::create(32, &pool);
  std::uint8_t* const data = a.data();
  EXPECT_EQ(pool.pool()->bufferCount(), 2u);

  AlignedHostBuffer c(std::move(a));
  EXPECT_EQ(pool.pool()->bufferCount(), 2u);
  EXPECT_EQ(c.data(), data);
  EXPECT_EQ(c.size(), 32u);
  EXPECT_TRUE(a.empty()) << "the source is left empty"; // NOLINT(bugprone-use-after-move)
  EXPECT_EQ(a.data(), nullptr);
  EXPECT_EQ(a.pool(), nullptr);

  b = std::move(c);
  EXPECT_EQ(pool.pool()->bufferCount(), 1u) << "the target's own entry has gone";
  EXPECT_EQ(b.data(), data);
  auto other = AlignedHostBuffer::create(8);
  auto const otherPool = other.pool();
  other = std::move(b);
  EXPECT_EQ(otherPool->bufferCount(), 0u);
  EXPECT_EQ(pool.pool()->bufferCount(), 1u);
  auto& self = other;
  other = std::move(self);
  EXPECT_EQ(other.data(), data);

  other.clear();
  EXPECT_EQ(pool.pool()->bufferCount(), 0u);
  EXPECT_EQ(pool.pool()->used(), 64u) << "the bytes are not given back";
  EXPECT_TRUE(other.empty());
  EXPECT_EQ(other.pool(), nullptr);
}

TEST(AlignedHostBuffer, BoundaryAMovedBufferOfNoBytesStaysKnown) {
  auto const pool = AlignedHostBuffer::createPool(64);
  {
    auto a = AlignedHostBuffer::create(0, &pool);
    EXPECT_EQ(pool.pool()->bufferCount(), 1u);
    AlignedHostBuffer b(std::move(a));
    EXPECT_EQ(pool.pool()->bufferCount(), 1u);
  }
  EXPECT_EQ(pool.pool()->bufferCount(), 0u);
}

TEST(AlignedHostBuffer, RequirementExternalBlocksStayTheirOwners) {
  alignas(32) std::uint8_t block[128];
  std::memset(block, 3, sizeof block);
  {
    auto const pool = AlignedHostBuffer::createPool(sizeof block, block);
    EXPECT_FALSE(pool.pool()->isManaged());
    auto a = AlignedHostBuffer::create(100, &pool);
    EXPECT_EQ(a.data(), block);
    a.data()[99] = 9;
    EXPECT_EQ(refusal(29, pool), "AlignedHostBuffer::Pool: insufficient memory\n"
                                 "\tA buffer requested 29 bytes from a pool with 128 bytes of which\n"
                                 "\t100 bytes are used by 1 other buffer(s). Pool is externally managed.\n");
  }
  EXPECT_EQ(block[99], 9);
  EXPECT_EQ(block[100], 3);
}

TEST(AlignedHostBuffer, BoundaryANullBlockMeansAnInternalPool) {
  EXPECT_TRUE(AlignedHostBuffer::createPool(16, nullptr).pool()->isManaged());
}

TEST(AlignedHostBuffer, RequirementAlignedDrawsSkipWhatLiesAskew) {
  auto const pool = AlignedHostBuffer::createPool(200);
  auto const a = AlignedHostBuffer::createAligned(33, &pool);
  EXPECT_EQ(pool.pool()->used(), 33u) << "nothing to skip";
  auto const b = AlignedHostBuffer::createAligned(64, &pool);
  EXPECT_TRUE(isAligned(b.data()));
  EXPECT_EQ(pool.pool()->used(), 128u);
  EXPECT_EQ(pool.pool()->bufferCount(), 2u) << "the pad does not stay";
  auto const c = AlignedHostBuffer::createAligned(1, &pool);
  // 71 bytes are left; with 31 skipped only 40 would be.
  auto const d = AlignedHostBuffer::createAligned(71, &pool);
  EXPECT_EQ(d.data(), c.data() + 1) << "no room for the pad: the request goes before it";
  EXPECT_EQ(pool.pool()->used(), 200u);
  EXPECT_TRUE(isAligned(AlignedHostBuffer::createAligned(7).data()));
}

TEST(AlignedHostBuffer, RequirementThePoolLivesAsLongAsItsLastBuffer) {
  AlignedHostBuffer last;
  std::weak_ptr<AlignedHostBuffer::Pool> watch;
  {
    auto const pool = AlignedHostBuffer::createPool(64);
    watch = pool.pool();
    last = AlignedHostBuffer::create(64, &pool);
  }
  ASSERT_FALSE(watch.expired());
  last.data()[63] = 1;
  last.clear();
  EXPECT_TRUE(watch.expired());
}

TEST(AlignedHostBuffer, RequirementMovesAndClearsOfOneRoomRunAtOnce) {
  auto const pool = AlignedHostBuffer::createPool(8 * 200);
  std::vector<std::vector<AlignedHostBuffer>> buffers(8);
  for (auto& mine : buffers)
    for (int n = 0; n < 200; ++n) mine.push_back(AlignedHostBuffer::create(1, &pool));
  std::vector<std::thread> threads;
  for (auto& mine : buffers)
    threads.emplace_back([&mine] {
      std::vector<AlignedHostBuffer> moved;
      for (auto& buffer : mine) moved.push_back(std::move(buffer));
      moved.resize(100);
      mine = std::move(moved);
    });
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(pool.pool()->bufferCount(), 800u);
}

TEST(GridHandle, RequirementOwnsABufferAndMovesItOn) {
  using Handle = nanovtt::GridHandle<AlignedHostBuffer>;
  Handle none;
  EXPECT_TRUE(none.empty());
  EXPECT_FALSE(none);
  EXPECT_EQ(none.data(), nullptr);
  EXPECT_EQ(none.size(), 0u);

  auto buffer = AlignedHostBuffer::create(40);
  auto const pool = buffer.pool();
  std::uint8_t* const data = buffer.data();
  Handle handle(std::move(buffer));
  Handle moved(std::move(handle));
  EXPECT_TRUE(handle.empty()); // NOLINT(bugprone-use-after-move)
  EXPECT_EQ(moved.data(), data);
  EXPECT_EQ(moved.size(), 40u);
  EXPECT_TRUE(moved);
  EXPECT_EQ(std::as_const(moved).buffer().data(), data);
  moved.reset();
  EXPECT_TRUE(moved.empty());
  EXPECT_EQ(pool->bufferCount(), 0u);
}

} // namespace
