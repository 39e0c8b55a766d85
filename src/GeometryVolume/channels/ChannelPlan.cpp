#include "GeometryVolume/channels/detail/ChannelPlan.h"

#include "GeometryVolume/core/HugePagesImpl.h"
#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/pools/ChannelMemoryPool.h"
#include "GeometryVolume/pools/Jemalloc.h"
#include "GeometryVolume/pools/KeptBlocksImpl.h"

#include <algorithm>
#include <memory>
#include <mutex>
#include <utility>

namespace VLN::TileTree3D::Internal {

std::int64_t tileSlotStride(std::int64_t elements, std::size_t elementSize) {
  std::uint64_t const bytes = static_cast<std::uint64_t>(elements) * elementSize;
  if (bytes % kBulkAlignment == 0) return elements;
  std::uint64_t const padded = bulkBytes(static_cast<std::uint64_t>(elements), elementSize);
  bool const divides = kBulkAlignment % elementSize == 0;
  return static_cast<std::int64_t>(padded / elementSize + (divides ? 0 : 1));
}

void* BlockList::add(std::int64_t elements, std::size_t elementSize, Source source) {
  auto const count = static_cast<std::uint64_t>(elements);
  if (count > static_cast<std::uint64_t>(INT64_MAX) / elementSize) return nullptr;
  auto entry = std::make_unique<Entry>(); // first: a block without a place would be lost
  entry->block = source(count, elementSize);
  if (!entry->block) return nullptr;
  entry->next = m_first;
  m_first = entry.release();
  ++m_size;
  return m_first->block;
}

void BlockList::take(BlockList& from) noexcept {
  Entry** end = &from.m_first;
  while (*end) end = &(*end)->next;
  *end = m_first;
  m_first = std::exchange(from.m_first, nullptr);
  m_size += std::exchange(from.m_size, 0);
}

void* BlockList::allocate(std::int64_t elements, std::size_t elementSize) {
  return add(elements, elementSize, [](std::uint64_t count, std::uint64_t size) {
    return ChannelMemoryPool::enabled() ? ChannelMemoryPool::allocate(count * size)
                                        : VLN::Internal::allocateKept(count * size);
  });
}

void* BlockList::allocateZeros(std::int64_t elements, std::size_t elementSize) {
  return add(elements, elementSize, [](std::uint64_t count, std::uint64_t size) {
    return VLN::Internal::allocateZerosKept(count * size);
  });
}

void* BlockList::allocate(std::int64_t elements, std::size_t elementSize, bool& zeros) {
  // Smaller blocks are mostly memory that was in use before, and still in the caches when it is written.
  constexpr std::int64_t kFreshBytes = std::int64_t(8) << 20;
  zeros = zeros && !ChannelMemoryPool::enabled() &&
          elements >= kFreshBytes / static_cast<std::int64_t>(elementSize);
  if (!zeros) return allocate(elements, elementSize);
  void* const block = allocateZeros(elements, elementSize);
  if (block) VLN::Internal::preferHugePages(block, static_cast<std::size_t>(elements) * elementSize);
  return block;
}

void BlockList::clear() {
  while (m_first) {
    std::unique_ptr<Entry> const entry(std::exchange(m_first, m_first->next));
    if (ChannelMemoryPool::enabled())
      ChannelMemoryPool::deallocate(entry->block);
    else
      VLN::Internal::deallocateKept(entry->block);
  }
  m_size = 0;
}

void handOverBlocks(BlockList& into, BlockList& from) noexcept {
  // Rare and short: one lock for all storages.
  static std::mutex mutex;
  std::lock_guard const lock(mutex);
  into.take(from);
}

void TileSpans::add(int depth, std::int64_t begin, std::int64_t end) {
  m_begins[depth] = begin;
  std::int64_t const count = std::max<std::int64_t>(0, end - begin);
  for (std::size_t n = depth; n < m_ends.size(); ++n) m_ends[n] += count;
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

TileSlots planSlots(int first, int last, DepthCounts const& counts,
                    FunctionRef<std::size_t(int, std::int64_t)> elements,
                    FunctionRef<std::int64_t(std::size_t)> slotOf) {
  TileSlots slots;
  for (int d = first; d <= last; ++d) {
    auto& list = slots.offsets[d];
    std::int64_t const n = counts[d];
    list.reserve(n);
    for (std::int64_t i = 0; i < n; ++i) {
      list.push_back(slots.total);
      if (std::size_t const size = elements(d, i)) slots.total += slotOf(size);
    }
  }
  return slots;
}

GrowthPlan planGrowth(int first, int last, DepthCounts const& own, TileCounts const& source,
                      std::int64_t fixedElements, std::int64_t stride) {
  GrowthPlan plan;
  for (int d = first; d <= last; ++d) {
    std::int64_t const n = std::max<std::int64_t>(0, source.tileCount(d)), begin = own[d];
    plan.wanted[d] = n;
    plan.changes = plan.changes || n != begin;
    plan.added.add(d, begin, n);
    auto& tiles = plan.tiles[d];
    if (fixedElements > 0)
      tiles = {fixedElements, plan.blockElements, stride};
    else if (stride > 0 && n > begin) {
      auto const elements = [&](std::int64_t i) {
        return std::max<std::int64_t>(0, source.elementCount(TreeIndex{i, d}));
      };
      std::int64_t const size = elements(begin);
      auto differs = begin + 1;
      while (differs < n && elements(differs) == size) ++differs;
      if (differs == n) {
        tiles = {size, plan.blockElements, size};
      } else {
        auto& offsets = plan.slots.offsets[d];
        offsets.reserve(n - begin);
        for (auto i = begin; i < n; ++i) {
          offsets.push_back(plan.blockElements);
          plan.blockElements += i < differs ? size : elements(i);
        }
      }
    }
    plan.blockElements += std::max<std::int64_t>(0, n - begin) * tiles.stride;
  }
  return plan;
}

bool isPermutation(std::vector<std::vector<std::int64_t>> const& lists, int first, int last,
                   DepthCounts const& counts) {
  for (int d = first; d <= last; ++d) {
    auto const& list = lists[d];
    auto const n = static_cast<std::size_t>(counts[d]);
    if (list.empty()) continue;
    if (list.size() != n) return false;
    std::vector<bool> seen(n);
    for (std::int64_t index : list) {
      if (index < 0 || static_cast<std::size_t>(index) >= n || seen[index]) return false;
      seen[index] = true;
    }
  }
  return true;
}

} // namespace VLN::TileTree3D::Internal
