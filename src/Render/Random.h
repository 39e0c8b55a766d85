// Counter-based random numbers: what is drawn depends on pixel, sample and the number of the draw alone, so
// that a picture does not depend on which thread drew which part of it.
#pragma once

#include "Reader/NanoVTTFormat.h"

namespace VLN::Render {

/// Three counters to 32 random bits each.
/// @source pcg3d of M. Jarzynski and M. Olano, "Hash Functions for GPU Rendering", JCGT 9(3), 2020.
NANOVTT_HD inline void scramble(std::uint32_t& x, std::uint32_t& y, std::uint32_t& z) {
  x = x * 1664525u + 1013904223u, y = y * 1664525u + 1013904223u, z = z * 1664525u + 1013904223u;
  x += y * z, y += z * x, z += x * y;
  x ^= x >> 16, y ^= y >> 16, z ^= z >> 16;
  x += y * z, y += z * x, z += x * y;
}

class Random {
public:
  NANOVTT_HD Random(std::uint32_t pixel, std::uint32_t sample)
      : m_pixel(pixel)
      , m_sample(sample) {}

  /// In [0, 1).
  NANOVTT_HD float next() {
    if (m_left == 0) {
      m_ready[0] = m_pixel, m_ready[1] = m_sample, m_ready[2] = m_draw++;
      scramble(m_ready[0], m_ready[1], m_ready[2]);
      m_left = 3;
    }
    return static_cast<float>(m_ready[--m_left] >> 8) * (1.0f / 16777216.0f);
  }

private:
  std::uint32_t m_pixel, m_sample, m_draw = 0;
  std::uint32_t m_ready[3] = {0, 0, 0};
  int m_left = 0;
};

} // namespace VLN::Render
