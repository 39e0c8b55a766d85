// Rollback: what is undone where something is thrown.
#pragma once

#include <utility>

namespace VLN::Internal {

/// Runs `undo` unless it is told that all went well.
template <class Undo> class Rollback {
public:
  explicit Rollback(Undo undo)
      : m_undo(std::move(undo)) {}
  ~Rollback() {
    if (m_armed) m_undo();
  }
  Rollback(Rollback const&) = delete;
  Rollback& operator=(Rollback const&) = delete;
  void dismiss() { m_armed = false; }

private:
  Undo m_undo;
  bool m_armed = true;
};

} // namespace VLN::Internal
