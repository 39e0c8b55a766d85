// The allocator against a list of records that is searched from end to end, under random operations.
#include "FakeBulk.h"

#include <algorithm>
#include <optional>
#include <random>

namespace {

using test::FakeBulk;
using VLN::TileTree3D::SimpleAllocator;

struct Block {
  void* ptr;
  std::uint64_t count, size, maxSize;
};

/// Free blocks lie in the order in which they became free; equal sizes are taken in that order.
struct Model {
  std::vector<Block> free, used;
  std::vector<void*> freed;
  std::vector<std::uint64_t> made;
  std::uint64_t count = 0;
  float extra = 0.1f;

  std::uint64_t part(std::uint64_t bytes) const {
    return static_cast<std::uint64_t>(static_cast<float>(bytes) * extra);
  }

  /// The address that is expected; nothing when a new block is due.
  std::optional<void*> allocate(std::uint64_t request) {
    ++count;
    std::size_t const none = free.size();
    std::size_t best = none;
    for (std::size_t i = 0; i < none && best == none; ++i)
      if (free[i].size == request) best = i;
    if (best != none) {
      free[best].maxSize = request;
    } else {
      for (std::size_t i = 0; i < none; ++i)
        if (free[i].size > request && (best == none || free[i].size < free[best].size)) best = i;
      if (best != none) free[best].maxSize = std::max(free[best].maxSize, request);
    }
    if (best != none) {
      free[best].count = count;
      used.push_back(free[best]);
      free.erase(free.begin() + static_cast<std::ptrdiff_t>(best));
      return used.back().ptr;
    }
    // All are smaller: the largest, and of equal ones the last, is to grow.
    for (std::size_t i = 0; i < none; ++i)
      if (best == none || free[i].size >= free[best].size) best = i;
    Block block{nullptr, count, request + part(request), request};
    bool grown = false;
    if (best != none) {
      // What the fake allocator answers: the size that the block has, or sixteen more than asked for.
      Block const old = free[best];
      free.erase(free.begin() + static_cast<std::ptrdiff_t>(best));
      // A block recorded as empty really holds one byte.
      bool const enough = old.size == 0 && request == 1;
      grown = enough || FakeBulk::canGrow(old.ptr, request);
      if (grown) block.ptr = old.ptr, block.size = enough ? 1 : request + 16;
      if (!grown) freed.push_back(old.ptr);
    }
    if (!grown) made.push_back(std::max<std::uint64_t>(1, block.size));
    used.push_back(block);
    return grown ? std::optional<void*>(block.ptr) : std::nullopt;
  }
  void deallocate(std::size_t i) {
    free.push_back(used[i]);
    used.erase(used.begin() + static_cast<std::ptrdiff_t>(i));
  }
  void age(std::uint64_t since) {
    std::stable_sort(free.begin(), free.end(),
                     [](Block const& a, Block const& b) { return a.size < b.size; });
    std::vector<Block> kept, shrunk;
    for (Block b : free) {
      std::uint64_t const target = b.maxSize + part(b.size);
      if (b.count < since) {
        freed.push_back(b.ptr);
      } else if (target < b.size) {
        b.size = target;
        shrunk.push_back(b);
      } else {
        kept.push_back(b);
      }
    }
    // Those that were shrunk come behind the others of their new size, smallest first.
    std::stable_sort(shrunk.begin(), shrunk.end(),
                     [](Block const& a, Block const& b) { return a.size < b.size; });
    free = kept;
    free.insert(free.end(), shrunk.begin(), shrunk.end());
  }
  std::uint64_t available() const {
    std::uint64_t sum = 0;
    for (auto const& b : free) sum += b.size;
    return sum;
  }
};

class SimpleAllocatorModel : public ::testing::TestWithParam<unsigned> {};

TEST_P(SimpleAllocatorModel, FollowsTheModel) {
  SCOPED_TRACE("seed " + std::to_string(GetParam()));
  std::mt19937_64 random(GetParam());
  auto const below = [&](std::uint64_t n) { return random() % n; };
  FakeBulk::reset();
  FakeBulk::growth = FakeBulk::Growth::kSometimes;
  SimpleAllocator pool{FakeBulk::functions()};
  Model model;

  for (int step = 0; step < 25000; ++step) {
    auto const what = below(1000);
    if (what < 500) {
      std::uint64_t const scale = std::uint64_t(1) << below(14);
      std::uint64_t const request = below(20) == 0 ? 0 : below(64) * scale;
      auto const expected = model.allocate(request);
      void* const got = pool.allocate(request);
      if (expected)
        ASSERT_EQ(got, *expected) << "step " << step << ", request " << request;
      else
        model.used.back().ptr = got;
    } else if (what < 985) {
      if (model.used.empty()) continue;
      std::size_t const i = below(model.used.size());
      pool.deallocate(model.used[i].ptr);
      model.deallocate(i);
    } else if (what < 992) {
      std::uint64_t const since = model.count - std::min(model.count, below(3000));
      pool.freeMemoryNotUsedSinceCount(since);
      model.age(since);
    } else if (what < 995) {
      float const extra = static_cast<float>(below(5)) * 0.1f;
      pool.setExtra(extra);
      model.extra = extra;
    } else if (what < 997) {
      pool.resetAllocationCount();
      for (auto& b : model.free) b.count = b.maxSize = 0;
      model.count = 0;
    } else if (what == 999 && below(4) == 0) {
      pool.freeAllMemory();
      for (auto const& b : model.free) model.freed.push_back(b.ptr);
      model.free.clear();
    }
    ASSERT_EQ(pool.freeStoreSize(), model.free.size()) << "step " << step;
    ASSERT_EQ(pool.usedStoreSize(), model.used.size()) << "step " << step;
    ASSERT_EQ(pool.allocationCount(), model.count) << "step " << step;
    ASSERT_EQ(pool.freeStoreAvailableMemory(), model.available()) << "step " << step;
    ASSERT_EQ(FakeBulk::made, model.made) << "step " << step;
    std::sort(FakeBulk::freed.begin(), FakeBulk::freed.end());
    std::sort(model.freed.begin(), model.freed.end());
    ASSERT_EQ(FakeBulk::freed, model.freed) << "step " << step;
    FakeBulk::freed.clear(), model.freed.clear();
    FakeBulk::made.clear(), model.made.clear();
  }
  EXPECT_EQ(FakeBulk::blocks.size(), model.free.size() + model.used.size()) << "nothing is lost";
}

INSTANTIATE_TEST_SUITE_P(Seeds, SimpleAllocatorModel, ::testing::Values(1u, 2u, 3u, 4u));

} // namespace
