#include "GeometryVolume/pools/Jemalloc.h"

#include "GeometryVolume/core/HugePagesImpl.h"
#include "GeometryVolume/core/WorkersImpl.h"
#include "GeometryVolume/pools/KeptBlocksImpl.h"
#include "vljemalloc/vljemalloc.h"

#include <atomic>
#include <exception>
#include <mutex>
#include <sstream>
#include <thread>

namespace VLN {

namespace {

std::mutex g_flushMutex;
std::atomic<bool> g_flushing{false};

void purgeArenas() { vlje_mallctl("arenas.purge", nullptr, nullptr, nullptr, 0); }
void flushOwnCache() { vlje_mallctl("thread.tcache.flush", nullptr, nullptr, nullptr, 0); }

/// Caches are flushed when memory is short, so that there may be none for the flushing itself: then they stay
/// as they are.
void flushWorkers() noexcept {
  try {
    if (Internal::runOnEachWorker(&flushOwnCache)) purgeArenas();
  } catch (...) {}
}

/// What `allocate` gives, for which blocks that wait go where there is no other memory.
template <class Allocate> void* orFromKept(Allocate const& allocate) {
  void* const block = allocate();
  return block || !Internal::freeKept() ? block : allocate();
}

} // namespace

void* allocate_jemalloc(std::uint64_t count, std::uint64_t elementSize) {
  std::uint64_t const bytes = bulkBytes(count, elementSize);
  void* const block = orFromKept([&] { return vlje_aligned_alloc(kBulkAlignment, bytes); });
  Internal::preferHugePages(block, bytes);
  return block;
}

void* allocateZeros_jemalloc(std::uint64_t count, std::uint64_t elementSize) {
  static_assert(kBulkAlignment == 1u << 6);
  std::uint64_t const bytes = bulkBytes(count, elementSize);
  return orFromKept([&] { return vlje_mallocx(bytes, VLJE_LG_ALIGN(6) | VLJE_ZERO); });
}

void deallocate_jemalloc(void* block) { vlje_free(block); }

void jemalloc_purge() { purgeArenas(); }

void jemalloc_flushCache() {
  if (g_flushing.load(std::memory_order_acquire)) return;
  std::lock_guard const lock(g_flushMutex);
  g_flushing.store(true, std::memory_order_release);
  struct Reset {
    ~Reset() { g_flushing.store(false, std::memory_order_release); }
  } const reset;
  Internal::freeKept();
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
