// State: a volume that Python holds, who uses it at the moment, and what is shown of it.
//
//   Core (of Python's objects) ---> State, shared ---> Volume
//   Pin (of each view) -----------^
//
// Calls that read share it, calls that change it have it alone. A view is a numpy array on the memory of a
// channel: it holds a Pin, which keeps the State alive and lets everything raise that would move or rewrite
// that memory. Waiting happens without the interpreter's lock, and ends at Ctrl-C.
#pragma once

#include "ChannelOps.h"

#include "Interop/IndexToWorld.h"

#include <atomic>
#include <condition_variable>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

namespace VLN::Python {

/// Lets Python act on a signal: takes the interpreter's lock for a moment, and throws what the signal's
/// handler raised.
void checkSignals();

/// What a change that is refused is told as: BufferError.
struct ViewsAlive : std::runtime_error {
  using std::runtime_error::runtime_error;
};

class State {
public:
  explicit State(Volume v)
      : volume(std::move(v)) {}
  State(State const&) = delete;
  State& operator=(State const&) = delete;

  Volume volume;
  Interop::IndexToWorld indexToWorld;

  /// @error std::runtime_error when the calling thread is changing the volume, as in a signal's handler.
  void beginRead();
  void endRead();
  /// @error As beginRead(), also when the thread is reading; ViewsAlive.
  void beginWrite(bool ignoreViews, std::string const& channel);
  void endWrite();

  int views() const { return m_views.load(); }
  /// Of one channel; of all for an empty name.
  int views(std::string const& channel) const;

private:
  friend class Pin;
  template <class Free> void wait(std::unique_lock<std::mutex>& lock, Free const& free);

  mutable std::mutex m_mutex;
  std::condition_variable m_changed;
  std::vector<std::thread::id> m_readers;
  std::thread::id m_writer;
  std::atomic<int> m_views{0};
  mutable std::mutex m_viewsMutex;
  std::map<std::string, int> m_viewsOf; ///< by channel
};

/// @pre The interpreter's lock is not held.
class Reading {
public:
  explicit Reading(State& state)
      : m_state(state) {
    m_state.beginRead();
  }
  ~Reading() { m_state.endRead(); }
  Reading(Reading const&) = delete;
  Reading& operator=(Reading const&) = delete;

private:
  State& m_state;
};

/// @pre The interpreter's lock is not held.
class Changing {
public:
  explicit Changing(State& state, bool ignoreViews = false)
      : m_state(state) {
    m_state.beginWrite(ignoreViews, "");
  }
  /// A change that leaves the memory of all other channels where it is.
  Changing(State& state, std::string const& channel)
      : m_state(state) {
    m_state.beginWrite(false, channel);
  }
  ~Changing() { m_state.endWrite(); }
  Changing(Changing const&) = delete;
  Changing& operator=(Changing const&) = delete;

private:
  State& m_state;
};

/// @pre Made while the calling thread reads or changes the volume.
class Pin {
public:
  Pin(std::shared_ptr<State> state, std::string channel)
      : m_state(std::move(state))
      , m_channel(std::move(channel)) {
    std::lock_guard const lock(m_state->m_viewsMutex);
    ++m_state->m_viewsOf[m_channel];
    ++m_state->m_views;
  }
  ~Pin() {
    std::lock_guard const lock(m_state->m_viewsMutex);
    --m_state->m_viewsOf.find(m_channel)->second;
    --m_state->m_views;
  }
  Pin(Pin const&) = delete;
  Pin& operator=(Pin const&) = delete;

private:
  std::shared_ptr<State> m_state;
  std::string m_channel;
};

/// OpenVDB is called by one thread at a time: reading a file forks, and a child must find no lock taken.
class UsingOpenVdb {
public:
  UsingOpenVdb();
  ~UsingOpenVdb();
  UsingOpenVdb(UsingOpenVdb const&) = delete;
  UsingOpenVdb& operator=(UsingOpenVdb const&) = delete;
};

} // namespace VLN::Python
