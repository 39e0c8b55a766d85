// Ends the program when a test does not come to its end: a deadlock would else stop the whole run.
#pragma once

#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <mutex>
#include <thread>

namespace test {

class Watchdog {
public:
  Watchdog(char const* what, std::chrono::milliseconds limit)
      : m_thread([this, what, limit] {
        std::unique_lock lock(m_mutex);
        if (m_condition.wait_for(lock, limit, [&] { return m_done; })) return;
        std::fprintf(stderr, "watchdog: %s did not end in %ld ms\n", what, long(limit.count()));
        std::abort();
      }) {}
  ~Watchdog() {
    {
      std::lock_guard const lock(m_mutex);
      m_done = true;
    }
    m_condition.notify_all();
    m_thread.join();
  }

private:
  std::mutex m_mutex;
  std::condition_variable m_condition;
  bool m_done = false;
  std::thread m_thread;
};

} // namespace test
