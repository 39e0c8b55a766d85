// ToIndex: many positions from world to index space.
#pragma once

#include "Interop/IndexToWorld.h"

#include <vector>

namespace VLN::Python {

/// Of a transform that is linear the matrix is read off once; others are asked for each position.
class ToIndex {
  using double3 = Velorn::Math::double3;

public:
  explicit ToIndex(Interop::IndexToWorld const& map)
      : m_map(map)
      , m_linear(map.besidesScale().rfind("not linear", 0) != 0) {
    if (!m_linear) return;
    m_origin = map.toIndex({0, 0, 0});
    for (int a = 0; a < 3; ++a) {
      double3 unit{0, 0, 0};
      unit[a] = 1;
      m_axes[a] = map.toIndex(unit) - m_origin;
    }
  }

  void operator()(std::vector<double3>& positions) const {
    for (double3& p : positions)
      p = m_linear ? m_origin + (m_axes[0] * p.x + m_axes[1] * p.y + m_axes[2] * p.z) : m_map.toIndex(p);
  }

private:
  Interop::IndexToWorld const& m_map;
  bool m_linear;
  double3 m_origin{0, 0, 0}, m_axes[3];
};

} // namespace VLN::Python
