#include "GeometryVolume/pools/TileDataAllocator.h"

#include <gtest/gtest.h>
#include <numeric>
#include <stdexcept>
#include <thread>
#include <vector>

namespace {

using VLN::TileDataAllocator;
using VLN::TileVector;

TEST(TileDataAllocator, RequirementDefaultState) {
  TileDataAllocator<float> const a;
  EXPECT_FALSE(a.isStatic());
  EXPECT_TRUE(a.constructs());
  EXPECT_EQ(a.base(), nullptr);
  EXPECT_EQ(a.used(), 0);
  EXPECT_EQ(a.limit(), 0);
  EXPECT_EQ(a.max_size(), std::size_t(PTRDIFF_MAX) / sizeof(float));
}

TEST(TileDataAllocator, RequirementStaticVectorFreesNothing) {
  std::vector<int> block(32, -1);
  TileDataAllocator<int> const a(block.data(), 32, true);
  EXPECT_EQ(a.max_size(), 32u);
  {
    TileVector<int> v(8, 7, a);
    EXPECT_EQ(v.data(), block.data());
    EXPECT_EQ(v.get_allocator().used(), 8);
    v.reserve(16);
    EXPECT_EQ(v.data(), block.data() + 8);
    EXPECT_EQ(v.get_allocator().used(), 24);
    EXPECT_EQ(v[7], 7);
  }
  EXPECT_EQ(block[0], 7);
  EXPECT_EQ(block[16], -1);
}

TEST(TileDataAllocator, BoundaryLimitIsTheLargestSize) {
  std::vector<int> block(8);
  TileVector<int> v(8, 1, TileDataAllocator<int>(block.data(), 8, true));
  EXPECT_THROW(v.push_back(2), std::length_error);
  EXPECT_EQ(v.size(), 8u);
}

TEST(TileDataAllocator, RequirementClearConstructFlagLeavesMemoryUntouched) {
  std::vector<int> block(16);
  std::iota(block.begin(), block.end(), 100);
  TileVector<int> const v(16, 5, TileDataAllocator<int>(block.data(), 16, false));
  EXPECT_EQ(v[0], 100);
  EXPECT_EQ(v[15], 115);
}

TEST(TileDataAllocator, RequirementStateTravelsWithMovesAndSwapsButNotWithCopies) {
  std::vector<int> block(16);
  TileVector<int> a(4, 1, TileDataAllocator<int>(block.data(), 16, true));
  TileVector<int> const copy(a);
  EXPECT_FALSE(copy.get_allocator().isStatic());
  TileVector<int> b(2, 9);
  a.swap(b);
  EXPECT_FALSE(a.get_allocator().isStatic());
  EXPECT_TRUE(b.get_allocator().isStatic());
  a = std::move(b);
  EXPECT_EQ(a.data(), block.data());
  EXPECT_EQ(a.get_allocator().used(), 4);
}

TEST(TileDataAllocator, RequirementThreadsCarveDisjointRanges) {
  constexpr int kThreads = 8, kEach = 500;
  std::vector<int> block(kThreads * kEach * 3);
  TileDataAllocator<int> a(block.data(), static_cast<std::int64_t>(block.size()), true);
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([&, t] {
      for (int n = 0; n < kEach; ++n) {
        int* const p = a.allocate(3);
        for (int i = 0; i < 3; ++i) p[i] += t + 1;
      }
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(a.used(), static_cast<std::int64_t>(block.size()));
  std::int64_t sum = std::accumulate(block.begin(), block.end(), std::int64_t(0));
  EXPECT_EQ(sum, 3 * kEach * kThreads * (kThreads + 1) / 2);
}

} // namespace
