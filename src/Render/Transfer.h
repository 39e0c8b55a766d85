// Transfer: from a value to colour and opacity.
#pragma once

#include "Render/Export.h"
#include "Render/Vec.h"

#include <array>
#include <string>
#include <utility>
#include <vector>

namespace VLN::Render {

inline constexpr int kTransferSize = 256;

/// The tables, for rays.
struct TransferView {
  float low = 0, scale = 1; ///< place in the tables = (value - low) * scale
  bool isLog = false;       ///< of log(value)
  float opacity[kTransferSize];
  Vec3 color[kTransferSize];

  /// 0 to 1. @edges No number is 0.
  NANOVTT_HD float place(float value) const {
    float const v = isLog ? std::log(value > 0 ? value : 1e-30f) : value;
    float const t = (v - low) * scale;
    return t > 0 ? (t < 1 ? t : 1.0f) : 0.0f;
  }
  NANOVTT_HD float opacityAt(float t) const {
    float const x = t * (kTransferSize - 1);
    int const n = static_cast<int>(x), m = n < kTransferSize - 1 ? n + 1 : n;
    return opacity[n] + (opacity[m] - opacity[n]) * (x - static_cast<float>(n));
  }
  NANOVTT_HD Vec3 colorAt(float t) const { return color[static_cast<int>(t * (kTransferSize - 1) + 0.5f)]; }
};

struct TransferOptions {
  float low = 0, high = 1; ///< values of the first and of the last colour
  bool log = false;        ///< equal factors of the value in place of equal steps
  std::string colors = "viridis";
  /// "linear", "linear_r", "sigmoid", "geom", "geom_r", "constant", or pairs "value:opacity,value:opacity"
  /// with straight lines between. What is narrower than a step of the table is as wide as one.
  std::string opacity = "linear";
  /// Opacity grows with the distance from this value in place of that from `low`.
  bool awayFrom = false;
  float from = 0;
};

/// The names of opacity functions.
VLN_RENDER_API std::vector<std::string> opacityNames();

class VLN_RENDER_API Transfer {
public:
  Transfer() = default;
  /// @error std::invalid_argument for a range that is none, an unknown map and an opacity that is none.
  explicit Transfer(TransferOptions const& options);

  TransferView const& view() const { return m_view; }
  /// No less than the opacity of any value between two. @cost Two reads.
  float largestOpacity(float low, float high) const;

private:
  TransferView m_view;
  /// [n][i]: the largest of 2^n entries from i on.
  std::array<std::array<float, kTransferSize>, 9> m_largest{};
};

} // namespace VLN::Render
