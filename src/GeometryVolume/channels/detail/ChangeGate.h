// ChangeGate: lets a thread that does not own a channel measure it.
//
//   state   0      at rest
//           n > 0  n changes are under way (they nest, and workers of one holder may overlap)
//           -1     somebody measures
//
// A change that meets a measurement waits for it, which is short. A measurement that meets a change gives up:
// the change may last, and may itself wait for locks that the measuring thread holds.
#pragma once

#include "GeometryVolume/core/Export.h"

namespace VLN::TileTree3D {

class VLN_API ChangeGate {
public:
  ChangeGate() = default;
  /// Copies of what the gate guards have gates of their own.
  ChangeGate(ChangeGate const&) {}
  ChangeGate& operator=(ChangeGate const&) { return *this; }

  void beginChange();
  void endChange();

  /// Keeps changes out while it lives, when it is true.
  class VLN_API Measurement {
  public:
    explicit Measurement(ChangeGate& gate);
    ~Measurement();
    Measurement(Measurement const&) = delete;
    Measurement& operator=(Measurement const&) = delete;
    explicit operator bool() const { return m_open; }

  private:
    ChangeGate& m_gate;
    bool m_open;
  };

private:
  alignas(int) int m_state = 0; ///< read and written as an atomic
};

} // namespace VLN::TileTree3D
