#include "Render/Threads.h"

#include <algorithm>
#include <atomic>
#include <exception>
#include <mutex>
#include <thread>
#include <vector>

namespace VLN::Render {

void forRanges(std::int64_t count, std::int64_t grain, int threads,
               std::function<void(std::int64_t, std::int64_t)> const& body,
               std::function<void(double)> const& watch) {
  grain = std::max<std::int64_t>(grain, 1);
  if (threads <= 0) threads = static_cast<int>(std::max(1u, std::thread::hardware_concurrency()));
  std::int64_t const pieces = (count + grain - 1) / grain;
  threads = static_cast<int>(std::min<std::int64_t>(threads, pieces));

  std::atomic<std::int64_t> next{0};
  std::atomic<bool> stop{false};
  std::exception_ptr error;
  std::mutex errorLock;
  auto const work = [&](bool isCaller) {
    try {
      while (!stop) {
        std::int64_t const piece = next++;
        if (piece >= pieces) break;
        body(piece * grain, std::min(count, (piece + 1) * grain));
        if (isCaller && watch) watch(double(std::min(pieces, next.load())) / double(pieces));
      }
    } catch (...) {
      std::lock_guard const lock(errorLock);
      if (!error) error = std::current_exception();
      stop = true;
    }
  };
  std::vector<std::thread> others;
  try {
    others.reserve(threads);
    for (int n = 1; n < threads; ++n) others.emplace_back(work, false);
  } catch (std::exception const&) {} // fewer threads do the same work
  work(true);
  for (auto& other : others) other.join();
  if (error) std::rethrow_exception(error);
}

} // namespace VLN::Render
