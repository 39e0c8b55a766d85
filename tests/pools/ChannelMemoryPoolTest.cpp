// The process's one pool of blocks, on the real allocator.
#include "GeometryVolume/pools/ChannelMemoryPool.h"

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <random>
#include <thread>
#include <unistd.h>
#include <vector>

namespace {

namespace Pool = VLN::TileTree3D::ChannelMemoryPool;

TEST(ChannelMemoryPool, RequirementIsOffAtLoadAndTheFlagGatesNothing) {
  EXPECT_FALSE(Pool::enabled());
  auto const before = Pool::allocationCount();
  void* const block = Pool::allocate(1000);
  ASSERT_NE(block, nullptr);
  EXPECT_EQ(reinterpret_cast<std::uintptr_t>(block) % 64, 0u);
  EXPECT_EQ(Pool::allocationCount(), before + 1);
  EXPECT_EQ(Pool::usedStoreSize(), 1u);
  Pool::enable();
  EXPECT_TRUE(Pool::enabled());
  EXPECT_EQ(Pool::usedStoreSize(), 1u);
  Pool::deallocate(block);
  EXPECT_EQ(Pool::freeStoreSize(), 1u);
  Pool::disable();
  EXPECT_FALSE(Pool::enabled());
  EXPECT_EQ(Pool::freeStoreSize(), 1u) << "switching has no other effect";
  Pool::freeAllMemory();
  EXPECT_EQ(Pool::freeStoreSize(), 0u);
  Pool::resetAllocationCount();
  EXPECT_EQ(Pool::allocationCount(), 0u);
}

TEST(ChannelMemoryPool, RequirementBlocksAreWritableToTheirRequestAfterEveryReuse) {
  std::mt19937 random(7);
  struct Held {
    unsigned char* data;
    std::size_t size;
    unsigned char mark;
  };
  std::vector<Held> held;
  for (int step = 0; step < 4000; ++step) {
    if (held.size() < 12 && random() % 2) {
      std::size_t const size = random() % 200000;
      auto* const data = static_cast<unsigned char*>(Pool::allocate(size));
      ASSERT_NE(data, nullptr);
      ASSERT_EQ(reinterpret_cast<std::uintptr_t>(data) % 64, 0u);
      auto const mark = static_cast<unsigned char>(random());
      std::memset(data, mark, size);
      held.push_back({data, size, mark});
    } else if (!held.empty()) {
      std::size_t const i = random() % held.size();
      for (std::size_t b = 0; b < held[i].size; ++b) ASSERT_EQ(held[i].data[b], held[i].mark);
      Pool::deallocate(held[i].data);
      held[i] = held.back();
      held.pop_back();
    }
    if (step % 500 == 499) Pool::freeMemoryNotUsedSinceCount(Pool::allocationCount() - 20);
  }
  for (auto const& h : held) Pool::deallocate(h.data);
  EXPECT_EQ(Pool::usedStoreSize(), 0u);
  Pool::freeAllMemory();
}

TEST(ChannelMemoryPool, RequirementSlack) {
  Pool::setExtra(0.5f);
  Pool::deallocate(Pool::allocate(1000));
  EXPECT_EQ(Pool::freeStoreAvailableMemory(), 1500u);
  Pool::freeAllMemory();
  Pool::setExtra(0.1f);
}

TEST(ChannelMemoryPool, RequirementManyThreads) {
  std::vector<std::thread> threads;
  for (int t = 0; t < 8; ++t) {
    threads.emplace_back([t] {
      std::mt19937 random(static_cast<unsigned>(t));
      for (int n = 0; n < 1000; ++n) {
        std::size_t const size = 1 + random() % 5000;
        auto* const data = static_cast<unsigned char*>(Pool::allocate(size));
        std::memset(data, t, size);
        if (n % 100 == 0) Pool::freeMemoryNotUsedSinceCount(Pool::allocationCount() / 2);
        ASSERT_EQ(data[size - 1], t);
        Pool::deallocate(data);
      }
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(Pool::usedStoreSize(), 0u);
  Pool::freeAllMemory();
}

TEST(ChannelMemoryPool, RequirementExitWithBlocksInUse) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_EXIT(
      {
        Pool::allocate(1000);
        Pool::deallocate(Pool::allocate(100000));
        // Gives its block back after the statics of the pool are gone.
        static struct Late {
          void* block = Pool::allocate(500);
          ~Late() {
            Pool::deallocate(block);
            std::fprintf(stderr, "late block returned\n");
          }
        } late;
        std::exit(0);
      },
      ::testing::ExitedWithCode(0), "late block returned");
}

TEST(ChannelMemoryPool, RequirementTheClosingLinesAreWrittenAtExit) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_EXIT(
      {
        dup2(2, 1);
        Pool::enableLog();
        std::exit(0);
      },
      ::testing::ExitedWithCode(0), "~SimpleAllocator.begin\n~SimpleAllocator.end");
  EXPECT_EXIT(
      {
        dup2(2, 1);
        Pool::allocationCount();
        std::exit(0);
      },
      ::testing::ExitedWithCode(0), ::testing::Not(::testing::HasSubstr("SimpleAllocator")));
}

} // namespace
