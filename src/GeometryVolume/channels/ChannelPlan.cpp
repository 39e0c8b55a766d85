#include "GeometryVolume/channels/ChannelPlan.h"

#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/pools/ChannelMemoryPool.h"
#include "GeometryVolume/pools/Jemalloc.h"

#include <algorithm>
#include <mutex>

namespace VLN::TileTree3D::Internal {

std::int64_t tileSlotStride(std::int64_t elements, std::size_t elementSize) {
  std::uint64_t const bytes = static_cast<std::uint64_t>(elements) * elementSize;
  if (bytes % kBulkAlignment == 0) return elements;
  std::uint64_t const padded = bulkBytes(static_cast<std::uint64_t>(elements), elementSize);
  bool const divides = kBulkAlignment % elementSize == 0;
  return static_cast<std::int64_t>(padded / elementSize + (divides ? 0 : 1));
}

void* allocateBlock(std::int64_t elements, std::size_t elementSize) {
  auto const count = static_cast<std::uint64_t>(elements);
  if (count > static_cast<std::uint64_t>(INT64_MAX) / elementSize) return nullptr;
  if (ChannelMemoryPool::enabled()) return ChannelMemoryPool::allocate(count * elementSize);
  return allocate_jemalloc(count, elementSize);
}

void freeBlocks(std::vector<void*>& blocks) {
  for (void* block : blocks) {
    if (ChannelMemoryPool::enabled())
      ChannelMemoryPool::deallocate(block);
    else
      deallocate_jemalloc(block);
  }
  blocks.clear();
}

void handOverBlocks(std::vector<void*>& into, std::vector<void*>& from) {
  // Rare and short: one lock for all storages.
  static std::mutex mutex;
  std::lock_guard const lock(mutex);
  into.insert(into.end(), from.begin(), from.end());
  from.clear();
}

void TileSpans::add(int depth, std::int64_t begin, std::int64_t end) {
  auto const d = static_cast<std::size_t>(depth);
  m_begins[d] = begin;
  std::int64_t const count = std::max<std::int64_t>(0, end - begin);
  for (std::size_t n = d; n < m_ends.size(); ++n) m_ends[n] += count;
}

void TileSpans::forEach(std::int64_t grain, FunctionRef<void(int, std::int64_t, std::int64_t)> body) const {
  ParallelOptions options;
  options.grain = grain;
  parallelFor(
      0, total(),
      [&](std::int64_t first, std::int64_t last) {
        auto d =
            static_cast<std::size_t>(std::upper_bound(m_ends.begin(), m_ends.end(), first) - m_ends.begin());
        for (; first < last; ++d) {
          std::int64_t const before = d == 0 ? 0 : m_ends[d - 1];
          std::int64_t const end = std::min(last, m_ends[d]);
          if (end > first)
            body(static_cast<int>(d), m_begins[d] + (first - before), m_begins[d] + (end - before));
          first = std::max(first, end);
        }
      },
      options);
}

void forEachDepth(int first, int last, FunctionRef<void(int)> body) {
  parallelFor(first, std::int64_t(last) + 1, [&](std::int64_t begin, std::int64_t end) {
    for (auto d = begin; d < end; ++d) body(static_cast<int>(d));
  });
}

bool isInjective(std::vector<std::int64_t> const& list, std::int64_t count) {
  std::vector<bool> seen(static_cast<std::size_t>(count));
  for (std::int64_t index : list) {
    if (index < 0 || index >= count || seen[static_cast<std::size_t>(index)]) return false;
    seen[static_cast<std::size_t>(index)] = true;
  }
  return true;
}

} // namespace VLN::TileTree3D::Internal
