// ChangeGate: lets a thread that does not own a channel measure it.
//
//   state   0      at rest
//           n > 0  n changes are under way (they nest, and workers of one holder may overlap)
//           -1     somebody measures
//
// A change that meets a measurement waits for it, which is short. A measurement that meets a change gives up:
// the change may last, and may itself wait for locks that the measuring thread holds.
#pragma once

#include <atomic>

namespace VLN::TileTree3D {

class ChangeGate {
public:
  ChangeGate() = default;
  /// Copies of what the gate guards have gates of their own.
  ChangeGate(ChangeGate const&) {}
  ChangeGate& operator=(ChangeGate const&) { return *this; }

  void beginChange() {
    for (int state = m_state.load(std::memory_order_relaxed);;) {
      if (state < 0) {
        m_state.wait(state, std::memory_order_relaxed);
        state = m_state.load(std::memory_order_relaxed);
      } else if (m_state.compare_exchange_weak(state, state + 1, std::memory_order_acquire,
                                               std::memory_order_relaxed)) {
        return;
      }
    }
  }
  void endChange() { m_state.fetch_sub(1, std::memory_order_release); }

  /// Keeps changes out while it lives, when it is true.
  class Measurement {
  public:
    explicit Measurement(ChangeGate& gate)
        : m_gate(gate) {
      int atRest = 0;
      m_open = m_gate.m_state.compare_exchange_strong(atRest, -1, std::memory_order_acquire,
                                                      std::memory_order_relaxed);
    }
    ~Measurement() {
      if (!m_open) return;
      m_gate.m_state.store(0, std::memory_order_release);
      m_gate.m_state.notify_all();
    }
    Measurement(Measurement const&) = delete;
    Measurement& operator=(Measurement const&) = delete;
    explicit operator bool() const { return m_open; }

  private:
    ChangeGate& m_gate;
    bool m_open;
  };

private:
  std::atomic<int> m_state{0};
};

} // namespace VLN::TileTree3D
