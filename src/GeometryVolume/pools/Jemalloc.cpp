#include "GeometryVolume/pools/Jemalloc.h"

#include "vljemalloc/vljemalloc.h"

#include <atomic>
#include <chrono>
#include <exception>
#include <mutex>
#include <sstream>
#include <tbb/parallel_for.h>
#include <tbb/partitioner.h>
#include <tbb/task_arena.h>
#include <tbb/task_group.h>
#include <thread>

namespace VLN {

namespace {

std::mutex g_flushMutex;
std::atomic<bool> g_flushing{false};

void flushOwnCache() { vlje_mallctl("thread.tcache.flush", nullptr, nullptr, nullptr, 0); }

/// How long the workers may leave the task lying.
constexpr std::chrono::milliseconds kPatience(10);

/// A cache can be flushed by its own thread only: spread one flush over each worker. Workers that all wait
/// for a lock which the flushing thread holds never come for the task: after a while this thread runs it
/// itself.
void flushEachWorker() {
  int const threads = tbb::this_task_arena::max_concurrency();
  if (threads < 2) return;
  tbb::task_arena arena(threads, 1);
  arena.initialize();
  arena.execute([&] {
    std::atomic<bool> done{false};
    tbb::task_group group;
    group.run([&] {
      tbb::parallel_for(
          0, threads - 1, 1, [](int) { flushOwnCache(); }, tbb::simple_partitioner());
      done.store(true, std::memory_order_release);
    });
    auto const until = std::chrono::steady_clock::now() + kPatience;
    while (!done.load(std::memory_order_acquire) && std::chrono::steady_clock::now() < until)
      std::this_thread::yield();
    group.wait();
  });
  vlje_mallctl("arenas.purge", nullptr, nullptr, nullptr, 0);
  arena.terminate();
}

/// Caches are flushed when memory is short, so that there may be none for the flushing itself: then they stay
/// as they are.
void flushWorkers() noexcept {
  try {
    flushEachWorker();
  } catch (...) {}
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
  try {
    std::thread(flushWorkers).join();
  } catch (std::exception const&) {} // no thread is to be had
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
