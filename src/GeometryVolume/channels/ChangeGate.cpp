#include "GeometryVolume/channels/detail/ChangeGate.h"

#include <atomic>

namespace VLN::TileTree3D {

void ChangeGate::beginChange() {
  std::atomic_ref<int> const atomic(m_state);
  for (int state = atomic.load(std::memory_order_relaxed);;) {
    if (state < 0) {
      atomic.wait(state, std::memory_order_relaxed);
      state = atomic.load(std::memory_order_relaxed);
    } else if (atomic.compare_exchange_weak(state, state + 1, std::memory_order_acquire,
                                            std::memory_order_relaxed)) {
      return;
    }
  }
}

void ChangeGate::endChange() { std::atomic_ref<int>(m_state).fetch_sub(1, std::memory_order_release); }

ChangeGate::Measurement::Measurement(ChangeGate& gate)
    : m_gate(gate) {
  int atRest = 0;
  m_open = std::atomic_ref<int>(gate.m_state)
               .compare_exchange_strong(atRest, -1, std::memory_order_acquire, std::memory_order_relaxed);
}

ChangeGate::Measurement::~Measurement() {
  if (!m_open) return;
  std::atomic_ref<int> const atomic(m_gate.m_state);
  atomic.store(0, std::memory_order_release);
  atomic.notify_all();
}

} // namespace VLN::TileTree3D
