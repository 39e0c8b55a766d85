#include "State.h"

#include <algorithm>
#include <chrono>
#include <stdexcept>

namespace VLN::Python {

using namespace std::chrono_literals;

template <class Free> void State::wait(std::unique_lock<std::mutex>& lock, Free const& free) {
  while (!free()) {
    if (m_changed.wait_for(lock, 50ms) != std::cv_status::timeout) continue;
    lock.unlock();
    checkSignals();
    lock.lock();
  }
}

void State::beginRead() {
  auto const self = std::this_thread::get_id();
  std::unique_lock lock(m_mutex);
  if (m_writer == self)
    throw std::runtime_error("the volume is being changed by the call that this one comes out of");
  wait(lock, [&] { return m_writer == std::thread::id(); });
  m_readers.push_back(self);
}

void State::endRead() {
  std::lock_guard const lock(m_mutex);
  m_readers.erase(std::find(m_readers.begin(), m_readers.end(), std::this_thread::get_id()));
  m_changed.notify_all();
}

int State::views(std::string const& channel) const {
  if (channel.empty()) return views();
  std::lock_guard const lock(m_viewsMutex);
  auto const found = m_viewsOf.find(channel);
  return found == m_viewsOf.end() ? 0 : found->second;
}

void State::beginWrite(bool ignoreViews, std::string const& channel) {
  auto const self = std::this_thread::get_id();
  std::unique_lock lock(m_mutex);
  if (m_writer == self || std::find(m_readers.begin(), m_readers.end(), self) != m_readers.end())
    throw std::runtime_error("the volume is in use by the call that this one comes out of");
  wait(lock, [&] { return m_writer == std::thread::id() && m_readers.empty(); });
  if (int const count = views(channel); count > 0 && !ignoreViews)
    throw ViewsAlive("the volume cannot be changed while " + std::to_string(count) +
                     (count == 1 ? " array shows" : " arrays show") +
                     " its memory: copy what you need and drop them (del), or leave 'with writable()'");
  m_writer = self;
}

void State::endWrite() {
  std::lock_guard const lock(m_mutex);
  m_writer = {};
  m_changed.notify_all();
}

namespace {
std::mutex g_mutex;
std::condition_variable g_free;
std::thread::id g_user;
} // namespace

UsingOpenVdb::UsingOpenVdb() {
  std::unique_lock lock(g_mutex);
  if (g_user == std::this_thread::get_id())
    throw std::runtime_error("a file is being read or written by the call that this one comes out of");
  while (g_user != std::thread::id()) {
    if (g_free.wait_for(lock, 50ms) != std::cv_status::timeout) continue;
    lock.unlock();
    checkSignals();
    lock.lock();
  }
  g_user = std::this_thread::get_id();
}

UsingOpenVdb::~UsingOpenVdb() {
  std::lock_guard const lock(g_mutex);
  g_user = {};
  g_free.notify_all();
}

} // namespace VLN::Python
