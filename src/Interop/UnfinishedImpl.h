// Unfinished: paths of outputs that are not whole yet, for a handler of signals that removes them.
#pragma once

#include <atomic>
#include <cstring>
#include <string>

namespace VLN::Interop {

/// More outputs at a time than `Count`, and longer paths, are merely not removed when the program is
/// interrupted.
/// @threads All operations at once; forEach() in a handler of signals too.
template <int Count> class Unfinished {
public:
  void add(std::string const& path) {
    if (path.size() >= sizeof Slot::path) return;
    for (Slot& slot : m_slots) {
      int expected = Slot::kFree;
      if (!slot.state.compare_exchange_strong(expected, Slot::kClaimed)) continue;
      std::memcpy(slot.path, path.c_str(), path.size() + 1);
      slot.state.store(Slot::kInUse);
      return;
    }
  }
  void remove(std::string const& path) {
    for (Slot& slot : m_slots)
      if (slot.state.load() == Slot::kInUse && path == slot.path) slot.state.store(Slot::kFree);
  }
  template <class F> void forEach(F const& f) const {
    for (Slot const& slot : m_slots)
      if (slot.state.load() == Slot::kInUse) f(slot.path);
  }

private:
  struct Slot {
    enum State { kFree, kClaimed, kInUse };
    std::atomic<int> state{kFree};
    char path[4096];
  };
  Slot m_slots[Count];
};

} // namespace VLN::Interop
