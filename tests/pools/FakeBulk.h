// A bulk allocator without memory: it hands out addresses, and remembers every call.
#pragma once

#include "GeometryVolume/pools/SimpleAllocator.h"

#include <cstdint>
#include <gtest/gtest.h>
#include <map>
#include <set>
#include <utility>
#include <vector>

namespace test {

struct FakeBulk {
  enum class Growth { kNever, kAlways, kSometimes };

  inline static std::map<void*, std::uint64_t> blocks;
  inline static std::vector<void*> freed;
  inline static std::vector<std::uint64_t> made;
  /// Block and size of each request to shrink.
  inline static std::vector<std::pair<void*, std::uint64_t>> shrunk;
  inline static Growth growth = Growth::kNever;
  inline static bool exhausted = false;
  inline static std::uintptr_t next = 1 << 20;

  static void reset() {
    blocks.clear();
    freed.clear();
    made.clear();
    shrunk.clear();
    growth = Growth::kNever;
    exhausted = false;
    next = 1 << 20;
  }
  static VLN::TileTree3D::BulkFunctions functions() { return {&mallocx, &xallocx, &free}; }

  /// Whether a block can grow to a size, when some can.
  static bool canGrow(void* block, std::uint64_t bytes) {
    if (growth != Growth::kSometimes) return growth == Growth::kAlways;
    return (reinterpret_cast<std::uintptr_t>(block) / 64 + bytes) % 3 == 0;
  }

private:
  static void* mallocx(std::size_t bytes, int flags) {
    EXPECT_EQ(flags, 6);
    EXPECT_GT(bytes, 0u) << "the allocator takes no size of 0";
    made.push_back(bytes);
    if (exhausted) return nullptr;
    void* const block = reinterpret_cast<void*>(next);
    next += 64;
    blocks[block] = bytes;
    return block;
  }
  static std::size_t xallocx(void* block, std::size_t bytes, std::size_t extra, int flags) {
    EXPECT_EQ(flags, 6);
    EXPECT_GT(bytes, 0u) << "the allocator takes no size of 0";
    EXPECT_TRUE(blocks.contains(block));
    auto& size = blocks[block];
    if (extra == 0) {
      shrunk.emplace_back(block, bytes);
      size = bytes;
    } else if (canGrow(block, bytes + extra)) {
      size = bytes + extra + 16; // a size class above what was asked for
    }
    return size;
  }
  static void free(void* block) {
    if (!block) return;
    EXPECT_EQ(blocks.erase(block), 1u) << "freed twice, or never made";
    freed.push_back(block);
  }
};

} // namespace test
