#include "GeometryVolume/core/YieldPointImpl.h"

#ifdef VLN_YIELD_POINTS

#include <atomic>
#include <chrono>
#include <thread>

namespace VLN::Internal {

namespace {

// Relaxed throughout: what is told here must not order the threads that are to be found unordered.
constinit std::atomic<std::uint64_t> g_seed{0}, g_threads{0}, g_yields{0};

struct Random {
  std::uint64_t seed = 0, state = 0;

  std::uint64_t next(std::uint64_t wanted) {
    if (seed != wanted) {
      seed = wanted;
      state = wanted * 0x9e3779b97f4a7c15u + g_threads.fetch_add(1, std::memory_order_relaxed);
    }
    state += 0x9e3779b97f4a7c15u;
    std::uint64_t z = (state ^ state >> 30) * 0xbf58476d1ce4e5b9u;
    z = (z ^ z >> 27) * 0x94d049bb133111ebu;
    return z ^ z >> 31;
  }
};
thread_local constinit Random t_random;

} // namespace

void setYieldSeed(std::uint64_t seed) {
  g_threads.store(0, std::memory_order_relaxed);
  g_seed.store(seed, std::memory_order_relaxed);
}
std::uint64_t yieldCount() { return g_yields.load(std::memory_order_relaxed); }

void yieldPoint() {
  std::uint64_t const seed = g_seed.load(std::memory_order_relaxed);
  if (seed == 0) return;
  std::uint64_t const r = t_random.next(seed);
  if (r % 4 != 0) return;
  g_yields.fetch_add(1, std::memory_order_relaxed);
  if (r / 4 % 8 == 0)
    std::this_thread::sleep_for(std::chrono::microseconds(r / 32 % 200));
  else
    std::this_thread::yield();
}

} // namespace VLN::Internal

#endif
