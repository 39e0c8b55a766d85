#include "Interop/ColorMap.h"

#include <algorithm>
#include <cmath>
#include <cstdio>

namespace VLN::Interop {

namespace {

// Oklab (B. Ottosson, "A perceptual color space for image processing", 2020).
struct Lab {
  double l, a, b;
};
struct Linear {
  double r, g, b;
  bool inGamut() const {
    constexpr double e = 1e-4;
    return r > -e && g > -e && b > -e && r < 1 + e && g < 1 + e && b < 1 + e;
  }
};

Linear toLinear(Lab const& c) {
  double const l = std::pow(c.l + 0.3963377774 * c.a + 0.2158037573 * c.b, 3);
  double const m = std::pow(c.l - 0.1055613458 * c.a - 0.0638541728 * c.b, 3);
  double const s = std::pow(c.l - 0.0894841775 * c.a - 1.2914855480 * c.b, 3);
  return {4.0767416621 * l - 3.3077115913 * m + 0.2309699292 * s,
          -1.2684380046 * l + 2.6097574011 * m - 0.3413193965 * s,
          -0.0041960863 * l - 0.7034186147 * m + 1.7076147010 * s};
}

std::uint8_t toByte(double linear) {
  double const c = std::clamp(linear, 0.0, 1.0);
  double const s = c <= 0.0031308 ? 12.92 * c : 1.055 * std::pow(c, 1 / 2.4) - 0.055;
  return static_cast<std::uint8_t>(std::lround(255 * s));
}

// Lightness, chroma and hue in degrees. Chroma gives way where the screen cannot show the colour.
Rgb fromLch(double lightness, double chroma, double hue) {
  double const angle = hue * 3.14159265358979323846 / 180;
  Linear linear{};
  for (double c = chroma; c >= 0; c -= 0.002) {
    linear = toLinear({lightness, c * std::cos(angle), c * std::sin(angle)});
    if (linear.inGamut()) break;
  }
  return {toByte(linear.r), toByte(linear.g), toByte(linear.b)};
}

std::array<Rgb, 256> sequentialTable() {
  std::array<Rgb, 256> table;
  for (int n = 0; n < 256; ++n) {
    double const t = n / 255.0;
    table[n] = fromLch(0.24 + 0.69 * t, 0.145, 312 - 205 * t);
  }
  return table;
}

std::array<Rgb, 256> divergingTable() {
  std::array<Rgb, 256> table;
  for (int n = 0; n < 256; ++n) {
    double const t = (n - 127.5) / 127.5; // -1 .. 1
    double const far = std::abs(t);
    table[n] = fromLch(0.97 - 0.55 * far, 0.19 * std::min(1.0, 1.4 * far), t < 0 ? 258 : 29);
  }
  return table;
}

std::array<Rgb, 256> grayTable() {
  std::array<Rgb, 256> table;
  for (std::size_t n = 0; n < 256; ++n) {
    auto const level = static_cast<std::uint8_t>(n);
    table[n] = {level, level, level};
  }
  return table;
}

// In as many digits as tell the ends of the range apart.
std::string label(double value, double range) {
  double const largest = std::max(std::abs(value), range);
  int const digits = range > 0 && std::isfinite(largest)
                         ? std::clamp(3 + static_cast<int>(std::ceil(std::log10(largest / range))), 3, 12)
                         : 3;
  char text[32];
  // What is nothing beside the range is zero.
  std::snprintf(text, sizeof text, "%.*g", digits, std::abs(value) < 1e-9 * range ? 0.0 : value);
  return text;
}

} // namespace

std::array<Rgb, 256> const& colorTable(ColorMap::Kind kind) {
  static std::array<Rgb, 256> const sequential = sequentialTable();
  static std::array<Rgb, 256> const diverging = divergingTable();
  static std::array<Rgb, 256> const gray = grayTable();
  return kind == ColorMap::Kind::kSequential ? sequential : kind == ColorMap::Kind::kGray ? gray : diverging;
}

ColorMap::ColorMap(Kind kind, double low, double high)
    : m_kind(kind)
    , m_low(low)
    , m_high(high) {
  if (!(m_high > m_low)) {
    double const around = std::isfinite(low) ? low : 0;
    double const by = around == 0 ? 1 : std::abs(around) / 2;
    m_low = around - by, m_high = around + by;
  }
}

ColorMap ColorMap::forRange(double low, double high) {
  if (low < 0 && high > 0) {
    double const far = std::max(-low, high);
    return {Kind::kDiverging, -far, far};
  }
  return {Kind::kSequential, low, high};
}

Rgb ColorMap::color(double value) const {
  if (std::isnan(value)) return notANumber();
  double const t = std::clamp((value - m_low) / (m_high - m_low), 0.0, 1.0);
  return colorTable(m_kind)[std::lround(255 * t)];
}

Image ColorMap::scale(int height, int textScale, Marks const& marks) const {
  Rgb const ink{40, 40, 40};
  int const bar = 12 * textScale, tick = 4 * textScale, gap = 3 * textScale;
  int const half = Image::textHeight(textScale) / 2 + 1;
  int const below = marks.notANumber ? bar + 2 * half : 0;
  height = std::max(height - below, 2 * half + 2);
  // As many ticks as leave some room between their labels.
  int const steps = height >= 16 * 2 * half ? 8 : height >= 8 * 2 * half ? 4 : 2;

  auto labelAt = [&](int n) {
    char const* const open = n == steps && marks.openHigh ? ">" : n == 0 && marks.openLow ? "<" : "";
    return open + label(m_low + (m_high - m_low) * n / steps, m_high - m_low);
  };
  int widest = marks.notANumber ? Image::textWidth("nan", textScale) : 0;
  for (int n = 0; n <= steps; ++n) widest = std::max(widest, Image::textWidth(labelAt(n), textScale));
  Image image(bar + tick + gap + widest, height + below);

  int const top = half, bottom = height - 1 - half; // rows of the high and the low end
  for (int y = top; y <= bottom; ++y) {
    double const t = double(bottom - y) / std::max(1, bottom - top);
    image.fill(0, y, bar, y + 1, color(m_low + (m_high - m_low) * t));
  }
  for (int n = 0; n <= steps; ++n) {
    int const y = bottom - static_cast<int>(std::lround(double(bottom - top) * n / steps));
    image.fill(bar, y, bar + tick, y + 1, ink);
    image.text(bar + tick + gap, y - Image::textHeight(textScale) / 2, labelAt(n), ink, textScale);
  }
  if (marks.notANumber) {
    int const y = height + below - bar;
    image.fill(0, y, bar, y + bar, notANumber());
    image.text(bar + tick + gap, y + bar / 2 - Image::textHeight(textScale) / 2, "nan", ink, textScale);
  }
  return image;
}

} // namespace VLN::Interop
