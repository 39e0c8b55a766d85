#include "GeometryVolume/pools/Jemalloc.h"

#include "vljemalloc/vljemalloc.h"

#include <atomic>
#include <chrono>
#include <memory>
#include <mutex>
#include <sstream>
#include <tbb/parallel_for.h>
#include <tbb/partitioner.h>
#include <tbb/task_arena.h>
#include <thread>

namespace VLN {

namespace {

std::mutex g_flushMutex;
std::atomic<bool> g_flushing{false};

void flushOwnCache() { vlje_mallctl("thread.tcache.flush", nullptr, nullptr, nullptr, 0); }

/// Shared with a task that may come to run only after the flush is over.
struct WorkerFlush {
  explicit WorkerFlush(int n)
      : threads(n) {}
  /// Runs the flush unless somebody else has begun it.
  bool run() {
    if (claimed.exchange(true, std::memory_order_acq_rel)) return false;
    tbb::parallel_for(
        0, threads - 1, 1, [](int) { flushOwnCache(); }, tbb::simple_partitioner());
    done.store(true, std::memory_order_release);
    return true;
  }

  int const threads;
  std::atomic<bool> claimed{false};
  std::atomic<bool> done{false};
};

/// How long the workers may leave the task lying.
constexpr std::chrono::milliseconds kPatience(10);

/// A cache can be flushed by its own thread only: spread one flush over each worker. Workers that all wait
/// for a lock which the flushing thread holds never come for the task, so it does not wait for them for ever.
void flushWorkers() {
  int const threads = tbb::this_task_arena::max_concurrency();
  if (threads < 2) return;
  tbb::task_arena arena(threads, 1);
  arena.initialize();
  auto const flush = std::make_shared<WorkerFlush>(threads);
  arena.enqueue([flush] { flush->run(); });
  auto const until = std::chrono::steady_clock::now() + kPatience;
  bool waited = false;
  while (!flush->done.load(std::memory_order_acquire)) {
    std::this_thread::yield();
    if (waited || std::chrono::steady_clock::now() < until) continue;
    waited = true;
    arena.execute([&] { flush->run(); });
  }
  vlje_mallctl("arenas.purge", nullptr, nullptr, nullptr, 0);
  arena.terminate();
}

} // namespace

void* allocate_jemalloc(std::uint64_t count, std::uint64_t elementSize) {
  return vlje_aligned_alloc(kBulkAlignment, bulkBytes(count, elementSize));
}

void deallocate_jemalloc(void* block) { vlje_free(block); }

void jemalloc_flushCache() {
  if (g_flushing.load(std::memory_order_acquire)) return;
  std::lock_guard const lock(g_flushMutex);
  g_flushing.store(true, std::memory_order_release);
  struct Reset {
    ~Reset() { g_flushing.store(false, std::memory_order_release); }
  } const reset;
  flushOwnCache();
  std::thread(flushWorkers).join();
}

namespace Internal {

jemalloc_stream::~jemalloc_stream() = default;

void jemalloc_dumpStats(jemalloc_stream& stream) {
  std::ostringstream text;
  vlje_malloc_stats_print(
      [](void* opaque, char const* piece) { *static_cast<std::ostream*>(opaque) << piece; },
      static_cast<std::ostream*>(&text), "gblma");
  std::string const whole = text.str();
  stream.write(whole.data(), whole.size());
}

} // namespace Internal
} // namespace VLN
