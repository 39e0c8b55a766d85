#include "GeometryVolume/core/Parallel.h"

#include "Ostil/Job.h"
#include "Velorn/ExceptionMessage.h"

#include <array>
#include <atomic>
#include <limits>
#include <optional>
#include <stdexcept>
#include <tbb/blocked_range.h>
#include <tbb/global_control.h>
#include <tbb/parallel_for.h>
#include <tbb/parallel_sort.h>
#include <tbb/partitioner.h>
#include <tbb/task_arena.h>
#include <utility>

namespace VLN {

struct AffinityPartitioner::Impl {
  tbb::affinity_partitioner partitioner;
};

AffinityPartitioner::AffinityPartitioner()
    : m_impl(std::make_unique<Impl>()) {}
AffinityPartitioner::~AffinityPartitioner() = default;

namespace {

using Range = tbb::blocked_range<std::int64_t>;

/// Polls the host before a chunk and remembers that a chunk was left out.
class CancelGuard {
public:
  explicit CancelGuard(Cancellation mode)
      : m_poll(mode == Cancellation::kPoll) {}
  bool stop() {
    if (!m_poll) return false;
    if (m_cancelled.load(std::memory_order_relaxed)) return true;
    if (!Ostil::isJobCancelled()) return false;
    m_cancelled.store(true, std::memory_order_relaxed);
    return true;
  }
  void throwIfCancelled() const {
    if (m_cancelled.load(std::memory_order_relaxed)) throw std::runtime_error(exceptionMessage);
  }

private:
  bool m_poll;
  std::atomic<bool> m_cancelled{false};
};

} // namespace

void parallelFor(std::int64_t begin, std::int64_t end, RangeBody body, ParallelOptions options) {
  if (begin >= end) return;
  CancelGuard guard(options.cancellation);
  std::int64_t const grain = std::max<std::int64_t>(1, options.grain);
  if (end - begin <= grain) {
    if (!guard.stop()) body(begin, end);
  } else {
    auto const chunk = [&](Range const& r) {
      if (!guard.stop()) body(r.begin(), r.end());
    };
    Range const range(begin, end, static_cast<std::size_t>(grain));
    tbb::this_task_arena::isolate([&] {
      if (options.affinity)
        tbb::parallel_for(range, chunk, options.affinity->impl().partitioner);
      else
        tbb::parallel_for(range, chunk);
    });
  }
  guard.throwIfCancelled();
}

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

void parallelSortPositions(std::uint64_t* order, std::int64_t n,
                           FunctionRef<bool(std::uint64_t, std::uint64_t)> less) {
  tbb::this_task_arena::isolate([&] {
    tbb::parallel_sort(order, order + n, [&](std::uint64_t a, std::uint64_t b) {
      if (less(a, b)) return true;
      return !less(b, a) && a < b;
    });
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
  std::vector<Counts> starts(static_cast<std::size_t>(chunkCount(0, n, kGrain)));
  auto const digit = [=](SortRecord const& r) { return (r.*word >> shift) & (kBuckets - 1); };
  parallelChunks(0, n, kGrain, [&](std::int64_t chunk, std::int64_t begin, std::int64_t end) {
    auto& counts = starts[static_cast<std::size_t>(chunk)];
    for (std::int64_t i = begin; i < end; ++i) ++counts[digit(from[i])];
  });
  std::uint32_t next = 0;
  for (std::size_t bucket = 0; bucket < kBuckets; ++bucket) {
    for (Counts& counts : starts) next += std::exchange(counts[bucket], next);
  }
  parallelChunks(0, n, kGrain, [&](std::int64_t chunk, std::int64_t begin, std::int64_t end) {
    auto& at = starts[static_cast<std::size_t>(chunk)];
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
    tbb::this_task_arena::isolate([&] { tbb::parallel_sort(records, records + n, less); });
    return;
  }
  // Digit by digit from the lowest: linear. Digits in which no two records differ are left out.
  std::vector<SortRecord> room(static_cast<std::size_t>(n));
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

void withThreads(int threads, FunctionRef<void()> body) {
  // More threads than the machine has are given too: the scheduler's own limit would leave them out.
  using Control = tbb::global_control;
  auto const wanted = static_cast<std::size_t>(std::max(threads, 1));
  std::optional<Control> limit;
  if (wanted > Control::active_value(Control::max_allowed_parallelism))
    limit.emplace(Control::max_allowed_parallelism, wanted);
  tbb::task_arena arena(threads);
  arena.execute([&] { body(); });
}

int parallelThreads() { return tbb::this_task_arena::max_concurrency(); }
int parallelThreadIndex() {
  int const index = tbb::this_task_arena::current_thread_index();
  return index < 0 ? 0 : index;
}

} // namespace VLN
