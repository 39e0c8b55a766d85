#include "GeometryVolume/pools/SimpleAllocator.h"

#include "GeometryVolume/pools/PoolLogImpl.h"
#include "vljemalloc/vljemalloc.h"

#include <algorithm>
#include <iterator>
#include <limits>

namespace VLN::TileTree3D {

namespace {

constexpr int kFlags = VLJE_LG_ALIGN(6);
constexpr std::uint64_t kMost = std::numeric_limits<std::uint64_t>::max();

/// The bulk allocator takes no size of 0.
std::uint64_t atLeastOne(std::uint64_t bytes) { return std::max<std::uint64_t>(1, bytes); }

} // namespace

template <class... Parts> void SimpleAllocator::log(Parts const&... parts) {
  if (m_log) Internal::writeLine(parts...);
}

SimpleAllocator::SimpleAllocator()
    : SimpleAllocator(BulkFunctions{&vlje_mallocx, &vlje_xallocx, &vlje_free}) {}
SimpleAllocator::SimpleAllocator(BulkFunctions const& bulk)
    : m_bulk(bulk) {}
SimpleAllocator::~SimpleAllocator() { logEnd(); }

void SimpleAllocator::logEnd() {
  std::lock_guard const lock(m_mutex);
  log("~SimpleAllocator.begin");
  log("~SimpleAllocator.end");
}

// In float, so that sizes do not depend on the width of intermediate results.
std::uint64_t SimpleAllocator::slack(std::uint64_t bytes) const {
  float const product = static_cast<float>(bytes) * m_extra;
  if (!(product > 0.0f)) return 0;
  return product < static_cast<float>(kMost) ? static_cast<std::uint64_t>(product) : kMost;
}

std::uint64_t SimpleAllocator::withSlack(std::uint64_t request) const {
  return request + std::min(slack(request), kMost - request);
}

void* SimpleAllocator::newBlock(std::uint64_t size) { return m_bulk.mallocx(atLeastOne(size), kFlags); }

std::uint64_t SimpleAllocator::growInPlace(Allocation const& block, std::uint64_t request) {
  if (!block.ptr) return 0;
  std::uint64_t const size = atLeastOne(block.size);
  return m_bulk.xallocx(block.ptr, size, request - size, kFlags);
}

void* SimpleAllocator::use(Allocation const& block) {
  auto const entry = m_usedStore.emplace(block.size, block);
  auto const [known, isNew] = m_usedStorePtrs.try_emplace(block.ptr, entry);
  if (!isNew) {
    // The block was freed behind our back, and its address has come again.
    if (block.ptr) m_usedStore.erase(known->second);
    known->second = entry;
  }
  return block.ptr;
}

void* SimpleAllocator::reuse(Store::iterator free, std::uint64_t maxSize) {
  Allocation block = free->second;
  block.allocationCount = m_allocationCount.load();
  block.maxSize = maxSize;
  use(block);
  m_freeStore.erase(free);
  return block.ptr;
}

void SimpleAllocator::logSizes(char const* indent) {
  log(indent, "freeStore.size = ", m_freeStore.size());
  log(indent, "usedStore.size = ", m_usedStore.size());
  log(indent, "usedStorePtrs.size = ", m_usedStorePtrs.size());
}

void SimpleAllocator::logBounds(std::uint64_t request, Store::iterator lower, Store::iterator upper) {
  bool const lowerValid = lower != m_freeStore.end(), upperValid = upper != m_freeStore.end();
  log("Alloc(", request, "):");
  logSizes(" - ");
  log(" - lowerBound valid = ", lowerValid);
  if (lowerValid) log(" - lowerBound smaller = ", lower->first < request);
  log(" - upperBound valid = ", upperValid);
  if (upperValid) log(" - upperBound larger = ", upper->first > request);
}

void* SimpleAllocator::allocate(std::uint64_t request) {
  std::lock_guard const lock(m_mutex);
  log("allocate.begin");
  std::uint64_t const now = ++m_allocationCount;

  auto const none = m_freeStore.end();
  auto const upper = m_freeStore.upper_bound(request);
  auto lower = m_freeStore.lower_bound(request);
  if (lower == none || lower->first != request)
    lower = lower == m_freeStore.begin() ? none : std::prev(lower);
  if (m_log) logBounds(request, lower, upper);

  void* ptr = nullptr;
  if (lower != none && lower->first == request) {
    log(" - found allocation of same size ", request, ". Re-using.");
    ptr = reuse(lower, request);
  } else if (upper != none) {
    log(" - found allocation of larger size ", upper->first, ". Re-using.");
    ptr = reuse(upper, std::max(upper->second.maxSize, request));
  } else {
    Allocation block{nullptr, now, 0, request};
    if (lower != none) {
      log(" - found allocation of smaller size ", lower->first, ". Re-using.");
      Allocation const old = lower->second;
      std::uint64_t const grown = growInPlace(old, request);
      m_freeStore.erase(lower);
      if (grown >= request) {
        log("  - Re-alloc succeeded.");
        block.ptr = old.ptr;
        block.size = grown;
      } else {
        m_bulk.free(old.ptr);
        block.size = withSlack(request);
        block.ptr = newBlock(block.size);
        log("  - Re-alloc failed. Allocated new. Extra percentage required = ",
            static_cast<float>(request - old.size) / static_cast<float>(old.size));
      }
    } else {
      log(" - found no available allocation. Allocating new.");
      block.size = withSlack(request);
      block.ptr = newBlock(block.size);
    }
    ptr = use(block);
  }
  log(" - returning ptr = ", ptr);
  log("allocate.end");
  return ptr;
}

void SimpleAllocator::deallocate(void* block) {
  std::lock_guard const lock(m_mutex);
  log("deallocate.begin");
  log("De-Alloc(", block, "):");
  log(" - before:");
  logSizes("  - ");
  if (auto const known = m_usedStorePtrs.find(block); known != m_usedStorePtrs.end()) {
    m_freeStore.insert(*known->second);
    m_usedStore.erase(known->second);
    m_usedStorePtrs.erase(known);
  } else {
    m_bulk.free(block);
  }
  log(" - after:");
  logSizes("  - ");
  log("  - freeStore contents:");
  if (m_log)
    for (auto const& [key, b] : m_freeStore)
      log("   - Key = ", key, ", Value = ", b.ptr, ", ", b.allocationCount, ", ", b.maxSize, ", ", b.size);
  log("deallocate.end");
}

void SimpleAllocator::enableLog() {
  std::lock_guard const lock(m_mutex);
  log("enableLog.begin");
  m_log = true;
  log("enableLog.end");
}

void SimpleAllocator::disableLog() {
  std::lock_guard const lock(m_mutex);
  log("disableLog.begin");
  m_log = false;
}

void SimpleAllocator::setExtra(float extra) {
  std::lock_guard const lock(m_mutex);
  log("setExtra.begin");
  m_extra = extra;
  log("setExtra.end");
}

std::uint64_t SimpleAllocator::freeStoreSize() {
  std::lock_guard const lock(m_mutex);
  log("freeStoreSize.begin");
  log("freeStoreSize.end");
  return m_freeStore.size();
}

std::uint64_t SimpleAllocator::usedStoreSize() {
  std::lock_guard const lock(m_mutex);
  log("usedStoreSize.begin");
  log("usedStoreSize.end");
  return m_usedStore.size();
}

std::uint64_t SimpleAllocator::freeStoreAvailableMemory() {
  std::lock_guard const lock(m_mutex);
  log("freeStoreAvailableMemory.begin");
  std::uint64_t sum = 0;
  for (auto const& [key, block] : m_freeStore) sum += key;
  log("freeStoreAvailableMemory.end");
  return sum;
}

std::uint64_t SimpleAllocator::allocationCount() {
  std::lock_guard const lock(m_mutex);
  log("allocationCount.begin");
  log("allocationCount.end");
  return m_allocationCount.load();
}

void SimpleAllocator::resetAllocationCount() {
  std::lock_guard const lock(m_mutex);
  log("resetAllocationCount.begin");
  log("resetAllocationCount():");
  for (auto& [key, block] : m_freeStore) block.allocationCount = block.maxSize = 0;
  m_allocationCount = 0;
  log("resetAllocationCount.end");
}

void SimpleAllocator::freeAllMemory() {
  std::lock_guard const lock(m_mutex);
  log("freeAllMemory.begin");
  for (auto const& [key, block] : m_freeStore) m_bulk.free(block.ptr);
  m_freeStore.clear();
  log("freeAllMemory.end");
}

void SimpleAllocator::freeMemoryNotUsedSinceCount(std::uint64_t count) {
  std::lock_guard const lock(m_mutex);
  log("freeMemoryNotUsedSinceCount.begin");
  log("freeMemoryNotUsedSinceCount(", count, "):");
  // Shrunk blocks wait here: put back at once they would lie ahead of the walk or be met again.
  Store shrunk;
  for (auto entry = m_freeStore.begin(); entry != m_freeStore.end();) {
    auto& [key, block] = *entry;
    log("Processing element: key = ", key, ", value = ", block.ptr, ", ", block.allocationCount, ", ",
        block.maxSize, ", ", block.size);
    // The slack is a part of the size held, unlike that of a new block, which is a part of the request.
    std::uint64_t const extra = slack(block.size);
    std::uint64_t const target = block.maxSize + std::min(extra, kMost - block.maxSize);
    if (block.allocationCount < count) {
      log(" - Freeing allocation with key ", key, " because allocation count was less than ", count);
      m_bulk.free(block.ptr);
      entry = m_freeStore.erase(entry);
    } else if (target < block.size) {
      log(" - Re-allocating allocation with key ", key, " because maxSize = ", block.maxSize,
          " and size = ", block.size);
      if (block.ptr) m_bulk.xallocx(block.ptr, atLeastOne(target), 0, kFlags);
      log("  - Re-alloc succeeded.");
      block.size = target;
      shrunk.emplace(target, block);
      entry = m_freeStore.erase(entry);
    } else {
      ++entry;
    }
  }
  m_freeStore.merge(shrunk);
  log("freeMemoryNotUsedSinceCount.end");
}

} // namespace VLN::TileTree3D
