#include "GeometryVolume/core/Parallel.h"

#include "Ostil/Job.h"
#include "Velorn/ExceptionMessage.h"

#include <atomic>
#include <optional>
#include <stdexcept>
#include <tbb/blocked_range.h>
#include <tbb/global_control.h>
#include <tbb/parallel_for.h>
#include <tbb/parallel_sort.h>
#include <tbb/partitioner.h>
#include <tbb/task_arena.h>

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

void parallelSort(SortRecord* records, std::int64_t n) {
  auto const less = [](SortRecord const& a, SortRecord const& b) {
    if (a.high != b.high) return a.high < b.high;
    return a.low != b.low ? a.low < b.low : a.value < b.value;
  };
  constexpr std::int64_t kParallelFrom = 500;
  if (n < kParallelFrom)
    std::sort(records, records + n, less);
  else
    tbb::this_task_arena::isolate([&] { tbb::parallel_sort(records, records + n, less); });
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
