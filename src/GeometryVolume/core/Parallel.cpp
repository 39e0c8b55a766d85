#include "GeometryVolume/core/Parallel.h"

#include "GeometryVolume/core/ThreadNotesImpl.h"

#include <algorithm>
#include <array>
#include <limits>
#include <utility>
#if !VLN_THREAD_NOTES
#include <tbb/blocked_range.h>
#include <tbb/parallel_for.h>
#include <tbb/parallel_sort.h>
#include <tbb/task_arena.h>
#endif

namespace VLN {

void parallelChunks(std::int64_t begin, std::int64_t end, std::int64_t grain,
                    FunctionRef<void(std::int64_t, std::int64_t, std::int64_t)> body,
                    Cancellation cancellation) {
  ParallelOptions options;
  options.cancellation = cancellation;
  parallelFor(
      0, chunkCount(begin, end, grain),
      [&](std::int64_t first, std::int64_t last) {
        for (std::int64_t c = first; c < last; ++c) {
          std::int64_t const b = begin + c * grain;
          body(c, b, std::min(end, b + grain));
        }
      },
      options);
}

namespace {

template <class T, class Less> void sortAll(T* first, T* last, Less const& less) {
#if VLN_THREAD_NOTES
  // The scheduler's sort hands ranges from thread to thread out of sight. Halves keep the comparisons side by
  // side.
  T* const middle = first + (last - first) / 2;
  parallelFor(0, 2, [&](std::int64_t begin, std::int64_t end) {
    if (begin == 0) std::sort(first, middle, less);
    if (end == 2) std::sort(middle, last, less);
  });
  std::inplace_merge(first, middle, last, less);
#else
  // On its own, as parallelFor() is.
  tbb::task_group_context context(tbb::task_group_context::isolated);
  tbb::this_task_arena::isolate([&] {
    tbb::parallel_for(
        tbb::blocked_range<int>(0, 1),
        [&](tbb::blocked_range<int> const&) { tbb::parallel_sort(first, last, less); }, context);
  });
#endif
}

} // namespace

void parallelSortPositions(std::uint64_t* order, std::int64_t n,
                           FunctionRef<bool(std::uint64_t, std::uint64_t)> less) {
  sortAll(order, order + n, [&](std::uint64_t a, std::uint64_t b) {
    if (less(a, b)) return true;
    return !less(b, a) && a < b;
  });
}

namespace {

constexpr int kDigitBits = 11, kDigitsOfAWord = 6;
constexpr std::size_t kBuckets = std::size_t(1) << kDigitBits;

/// Puts `from` into `to` in the order of one digit, keeping the order of equal ones. Chunks count and write
/// on their own: the result does not depend on the number of threads.
void sortByDigit(SortRecord const* from, SortRecord* to, std::int64_t n, std::uint64_t SortRecord::*word,
                 int shift) {
  constexpr std::int64_t kGrain = 32768;
  using Counts = std::array<std::uint32_t, kBuckets>;
  std::vector<Counts> starts(chunkCount(0, n, kGrain));
  auto const digit = [=](SortRecord const& r) { return (r.*word >> shift) & (kBuckets - 1); };
  parallelChunks(0, n, kGrain, [&](std::int64_t chunk, std::int64_t begin, std::int64_t end) {
    auto& counts = starts[chunk];
    for (std::int64_t i = begin; i < end; ++i) ++counts[digit(from[i])];
  });
  std::uint32_t next = 0;
  for (std::size_t bucket = 0; bucket < kBuckets; ++bucket) {
    for (Counts& counts : starts) next += std::exchange(counts[bucket], next);
  }
  parallelChunks(0, n, kGrain, [&](std::int64_t chunk, std::int64_t begin, std::int64_t end) {
    auto& at = starts[chunk];
    for (std::int64_t i = begin; i < end; ++i) to[at[digit(from[i])]++] = from[i];
  });
}

} // namespace

void parallelSort(SortRecord* records, std::int64_t n) {
  auto const less = [](SortRecord const& a, SortRecord const& b) {
    if (a.high != b.high) return a.high < b.high;
    return a.low != b.low ? a.low < b.low : a.value < b.value;
  };
  constexpr std::int64_t kParallelFrom = 500;
  if (n < kParallelFrom) {
    std::sort(records, records + n, less);
    return;
  }
  // The bits that differ anywhere, and whether what is there is in order already.
  bool sorted = true, valuesRise = true;
  SortRecord differing{0, 0, 0};
  for (std::int64_t i = 1; i < n; ++i) {
    differing.high |= records[i].high ^ records[0].high;
    differing.low |= records[i].low ^ records[0].low;
    sorted = sorted && less(records[i - 1], records[i]);
    valuesRise = valuesRise && records[i - 1].value < records[i].value;
  }
  if (sorted) return;
  if (!valuesRise || n > std::numeric_limits<std::uint32_t>::max()) {
    sortAll(records, records + n, less);
    return;
  }
  // Digit by digit from the lowest: linear. Digits in which no two records differ are left out.
  std::vector<SortRecord> room(n);
  SortRecord *from = records, *to = room.data();
  for (auto const word : {&SortRecord::low, &SortRecord::high}) {
    for (int digit = 0; digit < kDigitsOfAWord; ++digit) {
      if ((differing.*word >> (digit * kDigitBits) & (kBuckets - 1)) == 0) continue;
      sortByDigit(from, to, n, word, digit * kDigitBits);
      std::swap(from, to);
    }
  }
  if (from != records) std::copy_n(from, n, records);
}

} // namespace VLN
