// SimpleAllocator: recycles raw blocks, ordered by size.
//
//   allocate ──> exact size? larger? smaller that grows in place? ──> new block, with slack
//                      │
//   freeStore <────────┴──────────> usedStore
//   (key: bytes held)   deallocate   (key: bytes held) <── usedStorePtrs (key: address)
//
// A block returns to the bulk allocator only by freeAllMemory(), by ageing, or when it was to grow and could
// not.
#pragma once

#include "GeometryVolume/core/Export.h"

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <map>
#include <mutex>

namespace VLN::TileTree3D {

/// The three operations of the bulk allocator that blocks come from.
struct BulkFunctions {
  void* (*mallocx)(std::size_t bytes, int flags);
  std::size_t (*xallocx)(void* block, std::size_t bytes, std::size_t extra, int flags);
  void (*free)(void* block);
};

/// @threads Any thread: one recursive lock guards every operation.
class VLN_API SimpleAllocator {
public:
  /// Takes blocks from the library's bulk allocator.
  SimpleAllocator();
  explicit SimpleAllocator(BulkFunctions const& bulk);
  SimpleAllocator(SimpleAllocator const&) = delete;
  SimpleAllocator& operator=(SimpleAllocator const&) = delete;
  /// Gives no block back to the bulk allocator.
  ~SimpleAllocator();

  /// A 64-byte aligned block of at least `bytes`: of the free blocks one of that very size, else the smallest
  /// larger one, else the largest smaller one grown in place, else a new block with slack.
  /// @error Null when there is no memory.
  void* allocate(std::uint64_t bytes);
  /// Keeps the block for later. A block that this allocator did not hand out goes to the bulk allocator.
  void deallocate(void* block);

  void enableLog();
  void disableLog();
  /// Slack of new blocks, as a part of the request; 0.1 at first.
  void setExtra(float extra);

  std::uint64_t freeStoreSize();
  std::uint64_t usedStoreSize();
  /// @units Bytes.
  std::uint64_t freeStoreAvailableMemory();
  /// Number of calls of allocate() since the last reset.
  std::uint64_t allocationCount();
  /// Sets the count to 0, and forgets when free blocks were used and for how much. Blocks in use keep theirs.
  void resetAllocationCount();

  /// Gives all free blocks back.
  void freeAllMemory();
  /// Gives back free blocks whose latest hand-out was before `count`, and shrinks the others to the largest
  /// request that they served plus slack.
  void freeMemoryNotUsedSinceCount(std::uint64_t count);

  /// Writes the two lines that tell of the end, when the log is on.
  void logEnd();

private:
  struct Allocation {
    void* ptr;
    std::uint64_t allocationCount; ///< At the latest hand-out.
    std::uint64_t size;            ///< Bytes held.
    std::uint64_t maxSize;         ///< Largest request served since the count was reset.
  };
  using Store = std::multimap<std::uint64_t, Allocation>;

  std::uint64_t slack(std::uint64_t bytes) const;
  std::uint64_t withSlack(std::uint64_t request) const;
  void* newBlock(std::uint64_t size);
  /// The size that the block has after it was asked to hold `request` bytes without moving.
  std::uint64_t growInPlace(Allocation const& block, std::uint64_t request);
  /// Moves a free block that holds enough to the blocks in use.
  void* reuse(Store::iterator free, std::uint64_t maxSize);
  void* use(Allocation const& block);
  void logBounds(std::uint64_t request, Store::iterator lower, Store::iterator upper);
  void logSizes(char const* indent);
  template <class... Parts> void log(Parts const&... parts);

  Store m_freeStore;
  Store m_usedStore;
  std::map<void*, Store::iterator> m_usedStorePtrs;
  std::atomic<std::uint64_t> m_allocationCount{0};
  std::recursive_mutex m_mutex;
  bool m_log = false;
  float m_extra = 0.1f;
  BulkFunctions m_bulk;
};

} // namespace VLN::TileTree3D
