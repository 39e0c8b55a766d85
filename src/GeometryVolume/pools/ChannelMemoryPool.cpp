#include "GeometryVolume/pools/ChannelMemoryPool.h"

#include "GeometryVolume/pools/SimpleAllocator.h"

#include <atomic>

namespace VLN::TileTree3D::ChannelMemoryPool {

namespace {

constinit std::atomic<bool> g_enabled{false};

/// Never destroyed: channels that live in statics give their blocks back while the process ends.
SimpleAllocator& allocator() {
  static SimpleAllocator* const a = new SimpleAllocator;
  // Says the closing words in the allocator's stead.
  static struct Closing {
    SimpleAllocator* allocator;
    ~Closing() { allocator->logEnd(); }
  } const closing{a};
  return *a;
}

} // namespace

void enable() { g_enabled.store(true, std::memory_order_relaxed); }
void disable() { g_enabled.store(false, std::memory_order_relaxed); }
bool enabled() { return g_enabled.load(std::memory_order_relaxed); }

void* allocate(std::uint64_t bytes) { return allocator().allocate(bytes); }
void deallocate(void* block) { allocator().deallocate(block); }
void enableLog() { allocator().enableLog(); }
void disableLog() { allocator().disableLog(); }
void setExtra(float extra) { allocator().setExtra(extra); }
std::uint64_t freeStoreSize() { return allocator().freeStoreSize(); }
std::uint64_t usedStoreSize() { return allocator().usedStoreSize(); }
std::uint64_t freeStoreAvailableMemory() { return allocator().freeStoreAvailableMemory(); }
std::uint64_t allocationCount() { return allocator().allocationCount(); }
void resetAllocationCount() { allocator().resetAllocationCount(); }
void freeAllMemory() { allocator().freeAllMemory(); }
void freeMemoryNotUsedSinceCount(std::uint64_t count) { allocator().freeMemoryNotUsedSinceCount(count); }

} // namespace VLN::TileTree3D::ChannelMemoryPool
