// The scheduler's own templates. Under the thread sanitizer this source alone is not instrumented: what the
// templates do with the scheduler's tasks would look like races, and what they synchronise would hide some.
// Bodies come from elsewhere, and are.
#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/core/ThreadNotesImpl.h"
#include "GeometryVolume/core/WorkersImpl.h"
#include "Ostil/Job.h"
#include "Velorn/ExceptionMessage.h"

#include <atomic>
#include <chrono>
#include <optional>
#include <stdexcept>
#include <tbb/blocked_range.h>
#include <tbb/global_control.h>
#include <tbb/parallel_for.h>
#include <tbb/partitioner.h>
#include <tbb/task_arena.h>
#include <tbb/task_group.h>
#include <thread>

namespace VLN {

struct AffinityPartitioner::Impl {
  tbb::affinity_partitioner partitioner;
};

AffinityPartitioner::AffinityPartitioner()
    : m_impl(new Impl) {}
AffinityPartitioner::~AffinityPartitioner() { delete m_impl; }

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

struct Loop {
  RangeBody body;
  CancelGuard& guard;
  Internal::HandOver handOver{};

  void run(std::int64_t begin, std::int64_t end) {
    Internal::HandOver::Chunk const chunk(handOver);
    if (!guard.stop()) body(begin, end);
  }
};
/// What the scheduler copies into its tasks.
struct LoopChunk {
  Loop* loop;
  void operator()(Range const& r) const { loop->run(r.begin(), r.end()); }
};

} // namespace

void parallelFor(std::int64_t begin, std::int64_t end, RangeBody body, ParallelOptions options) {
  if (begin >= end) return;
  CancelGuard guard(options.cancellation);
  std::int64_t const grain = std::max<std::int64_t>(1, options.grain);
  if (end - begin <= grain) {
    if (!guard.stop()) body(begin, end);
  } else {
    Loop loop{body, guard};
    Range const range(begin, end, static_cast<std::size_t>(grain));
    // On its own: what is thrown beside a loop that runs inside another would cut it short, and nobody would
    // know.
    tbb::task_group_context context(tbb::task_group_context::isolated);
    tbb::this_task_arena::isolate([&] {
      if (options.affinity)
        tbb::parallel_for(range, LoopChunk{&loop}, options.affinity->impl().partitioner, context);
      else
        tbb::parallel_for(range, LoopChunk{&loop}, context);
    });
  }
  guard.throwIfCancelled();
}

void withThreads(int threads, FunctionRef<void()> body) {
  // More threads than the machine has are given too: the scheduler's own limit would leave them out.
  using Control = tbb::global_control;
  auto const wanted = static_cast<std::size_t>(std::max(threads, 1));
  std::optional<Control> limit;
  if (wanted > Control::active_value(Control::max_allowed_parallelism))
    limit.emplace(Control::max_allowed_parallelism, wanted);
  tbb::task_arena arena(threads);
  Internal::HandOver handOver;
  arena.execute([&] {
    Internal::HandOver::Chunk const chunk(handOver);
    body();
  });
}

bool Internal::runOnEachWorker(void (*body)()) {
  constexpr std::chrono::milliseconds kPatience(10); // how long the workers may leave the task lying
  int const threads = tbb::this_task_arena::max_concurrency();
  if (threads < 2) return false;
  tbb::task_arena arena(threads, 1);
  arena.initialize();
  arena.execute([&] {
    std::atomic<bool> done{false};
    tbb::task_group group;
    group.run([&] {
      tbb::parallel_for(
          0, threads - 1, 1, [body](int) { body(); }, tbb::simple_partitioner());
      done.store(true, std::memory_order_release);
    });
    auto const until = std::chrono::steady_clock::now() + kPatience;
    while (!done.load(std::memory_order_acquire) && std::chrono::steady_clock::now() < until)
      std::this_thread::yield();
    group.wait();
  });
  arena.terminate();
  return true;
}

int parallelThreads() { return tbb::this_task_arena::max_concurrency(); }
int parallelThreadIndex() {
  int const index = tbb::this_task_arena::current_thread_index();
  return index < 0 ? 0 : index;
}

} // namespace VLN
