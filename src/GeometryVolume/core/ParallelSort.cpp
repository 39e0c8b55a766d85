#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/core/ThreadNotesImpl.h"

#include <algorithm>
#include <array>
#include <bit>
#include <limits>
#include <utility>
#include <vector>
#if !VLN_THREAD_NOTES
#include <tbb/blocked_range.h>
#include <tbb/parallel_for.h>
#include <tbb/parallel_sort.h>
#include <tbb/task_arena.h>
#endif

namespace VLN {

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

bool comesBefore(SortRecord const& a, SortRecord const& b) {
  if (a.high != b.high) return a.high < b.high;
  return a.low != b.low ? a.low < b.low : a.value < b.value;
}

/// Records that one task takes.
constexpr std::int64_t kGrain = 32768;
constexpr int kDigitBits = 11;
constexpr std::size_t kBuckets = std::size_t(1) << kDigitBits;

/// What tells records apart.
struct Differences {
  /// Bits by which not all keys are equal. Where all keys have the same difference to the bit three above,
  /// which orders them as well, a bit is left out: keys that interleave three coordinates have many of those
  /// around the origin.
  std::uint64_t high = 0, low = 0;
  bool sorted = true, valuesRise = true;
};

Differences differences(SortRecord const* records, std::int64_t n) {
  struct Found {
    std::uint64_t high = 0, low = 0;           // bits that differ
    std::uint64_t highSteps = 0, lowSteps = 0; // bits whose difference to the bit three above differs
    bool sorted = true, valuesRise = true;
  };
  Found const all = parallelReduce(
      1, n, kGrain, Found{},
      [&](std::int64_t begin, std::int64_t end) {
        Found found;
        for (std::int64_t i = begin; i < end; ++i) {
          SortRecord const &here = records[i], &before = records[i - 1];
          std::uint64_t const high = here.high ^ before.high, low = here.low ^ before.low;
          found.high |= high, found.low |= low;
          found.highSteps |= high ^ high >> 3, found.lowSteps |= low ^ low >> 3;
          found.sorted = found.sorted && comesBefore(before, here);
          found.valuesRise = found.valuesRise && before.value < here.value;
        }
        return found;
      },
      [](Found a, Found const& b) {
        a.high |= b.high, a.low |= b.low, a.highSteps |= b.highSteps, a.lowSteps |= b.lowSteps;
        a.sorted = a.sorted && b.sorted, a.valuesRise = a.valuesRise && b.valuesRise;
        return a;
      });
  return {all.high & all.highSteps, all.low & all.lowSteps, all.sorted, all.valuesRise};
}

/// Puts `from` into `to` in the order of one digit, keeping the order of equal ones. Chunks count and write
/// on their own: the result does not depend on the number of threads.
template <class T, class Digit> void sortByDigit(T const* from, T* to, std::int64_t n, Digit const& digit) {
  using Counts = std::array<std::uint32_t, kBuckets>;
  std::vector<Counts> starts(chunkCount(0, n, kGrain));
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

/// The bits of a key that tell records apart, side by side.
class ShortKeys {
public:
  static constexpr int kMaxBits = 32;

  explicit ShortKeys(Differences const& differences) {
    addRuns(differences.low, &SortRecord::low);
    addRuns(differences.high, &SortRecord::high);
    // Bits between two runs do no harm. One run is taken in one step.
    for (std::size_t n = 0; n + 1 < m_runs.size();) {
      Run &run = m_runs[n], &next = m_runs[n + 1];
      int const gap = next.from - (run.from + run.bits);
      if (run.word == next.word && m_bits + gap <= kMaxBits) {
        run.bits += gap + next.bits, m_bits += gap;
        m_runs.erase(m_runs.begin() + static_cast<std::ptrdiff_t>(n) + 1);
      } else
        ++n;
    }
  }
  int bits() const { return m_bits; }
  std::uint64_t operator()(SortRecord const& record) const {
    std::uint64_t key = 0;
    int at = 0;
    for (Run const& run : m_runs) {
      key |= (record.*run.word >> run.from & ((std::uint64_t(1) << run.bits) - 1)) << at;
      at += run.bits;
    }
    return key;
  }

private:
  struct Run {
    std::uint64_t SortRecord::*word;
    int from, bits;
  };
  void addRuns(std::uint64_t mask, std::uint64_t SortRecord::*word) {
    while (mask != 0) {
      int const from = std::countr_zero(mask), bits = std::countr_one(mask >> from);
      m_runs.push_back({word, from, bits});
      m_bits += bits;
      mask &= bits == 64 ? 0 : ~(((std::uint64_t(1) << bits) - 1) << from);
    }
  }
  std::vector<Run> m_runs;
  int m_bits = 0;
};

/// Records whose keys need few bits: the bits and the record's place in one word each are what is sorted.
void sortByShortKeys(SortRecord* records, std::int64_t n, ShortKeys const& keyOf) {
  constexpr int kPlaceBits = 32;
  std::vector<std::uint64_t> words(n), room(n);
  parallelChunks(0, n, kGrain, [&](std::int64_t, std::int64_t begin, std::int64_t end) {
    for (std::int64_t i = begin; i < end; ++i)
      words[i] = keyOf(records[i]) << kPlaceBits | static_cast<std::uint64_t>(i);
  });
  for (int bit = 0; bit < keyOf.bits(); bit += kDigitBits) {
    sortByDigit(words.data(), room.data(), n,
                [=](std::uint64_t word) { return word >> (kPlaceBits + bit) & (kBuckets - 1); });
    words.swap(room);
  }
  std::vector<SortRecord> sorted(n);
  parallelChunks(0, n, kGrain, [&](std::int64_t, std::int64_t begin, std::int64_t end) {
    for (std::int64_t i = begin; i < end; ++i)
      sorted[i] = records[words[i] & ((std::uint64_t(1) << kPlaceBits) - 1)];
  });
  std::copy(sorted.begin(), sorted.end(), records);
}

/// Digit by digit from the lowest; those in which no two records differ are left out.
void sortByDigits(SortRecord* records, std::int64_t n, Differences const& differences) {
  std::vector<SortRecord> room(n);
  SortRecord *from = records, *to = room.data();
  for (auto const& [word, mask] :
       {std::pair(&SortRecord::low, differences.low), std::pair(&SortRecord::high, differences.high)}) {
    for (int shift = 0; shift < 64; shift += kDigitBits) {
      if ((mask >> shift & (kBuckets - 1)) == 0) continue;
      sortByDigit(from, to, n,
                  [=, word = word](SortRecord const& r) { return r.*word >> shift & (kBuckets - 1); });
      std::swap(from, to);
    }
  }
  if (from != records) std::copy_n(from, n, records);
}

} // namespace

void parallelSort(SortRecord* records, std::int64_t n) {
  constexpr std::int64_t kParallelFrom = 500;
  if (n < kParallelFrom) {
    std::sort(records, records + n, comesBefore);
    return;
  }
  Differences const found = differences(records, n);
  if (found.sorted) return;
  // Both ways are linear, and keep the order of equal keys.
  if (!found.valuesRise || n > std::numeric_limits<std::uint32_t>::max()) {
    sortAll(records, records + n, comesBefore);
    return;
  }
  ShortKeys const keys(found);
  if (keys.bits() <= ShortKeys::kMaxBits)
    sortByShortKeys(records, n, keys);
  else
    sortByDigits(records, n, found);
}

} // namespace VLN
