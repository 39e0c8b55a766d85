#include "Render/Transfer.h"

#include "Render/Colors.h"

#include <algorithm>
#include <bit>
#include <charconv>
#include <cmath>
#include <stdexcept>

namespace VLN::Render {

namespace {

using Points = std::vector<std::pair<float, float>>; // value, opacity

float number(std::string_view text, std::string const& whole) {
  float v = 0;
  auto const [end, error] = std::from_chars(text.data(), text.data() + text.size(), v);
  if (error != std::errc() || end != text.data() + text.size() || !std::isfinite(v))
    throw std::invalid_argument("'" + whole + "' is no opacity: a name, or value:opacity,value:opacity");
  return v;
}

Points pointsOf(std::string const& text) {
  Points points;
  for (std::size_t at = 0; at <= text.size();) {
    std::size_t const end = std::min(text.find(',', at), text.size());
    std::string_view const item(text.data() + at, end - at);
    std::size_t const colon = item.find(':');
    if (colon == std::string_view::npos)
      throw std::invalid_argument("'" + text + "' is no opacity: a name, or value:opacity,value:opacity");
    points.emplace_back(number(item.substr(0, colon), text), number(item.substr(colon + 1), text));
    if (points.back().second < 0 || points.back().second > 1)
      throw std::invalid_argument("opacities lie in 0..1, but '" + text + "' has another one");
    if (points.size() > 1 && points.back().first < points[points.size() - 2].first)
      throw std::invalid_argument("values of '" + text + "' do not rise");
    at = end + 1;
  }
  return points;
}

float between(Points const& points, float v) {
  if (v <= points.front().first) return points.front().second;
  for (std::size_t n = 1; n < points.size(); ++n) {
    auto const& [x0, y0] = points[n - 1];
    auto const& [x1, y1] = points[n];
    if (v < x1) return y0 + (y1 - y0) * (v - x0) / (x1 - x0);
  }
  return points.back().second;
}

// What is narrower than a step of the table is as wide as one, and not lost: the entry next to a point that
// is higher, or lower, than what stands on both its sides takes its opacity. Of both in one entry the higher.
void keepExtremes(TransferView& view, Points const& points) {
  auto const entryOf = [&](std::size_t n) {
    float const v = view.isLog ? std::log(std::max(points[n].first, 1e-30f)) : points[n].first;
    return (v - view.low) * view.scale * (kTransferSize - 1);
  };
  for (bool isPeak : {false, true})
    for (std::size_t n = 0; n < points.size(); ++n) {
      float const own = points[n].second;
      // The next point of another opacity on a side; none behind a plateau that is as wide as a step.
      auto const isBeyond = [&](std::ptrdiff_t way) {
        auto at = static_cast<std::ptrdiff_t>(n);
        do at += way;
        while (at >= 0 && at < static_cast<std::ptrdiff_t>(points.size()) && points[at].second == own);
        if (at < 0 || at >= static_cast<std::ptrdiff_t>(points.size())) return false;
        auto const last = static_cast<std::size_t>(at - way);
        float const other = points[at].second;
        return std::abs(entryOf(last) - entryOf(n)) < 1 && (isPeak ? own > other : own < other);
      };
      float const at = entryOf(n);
      if (!(at >= 0 && at <= kTransferSize - 1) || !isBeyond(-1) || !isBeyond(1)) continue;
      float& entry = view.opacity[std::lround(at)];
      entry = isPeak ? std::max(entry, own) : std::min(entry, own);
    }
}

using Shape = float (*)(float);
struct Named {
  char const* name;
  Shape shape;
};
constexpr Named kShapes[] = {
    {"linear", [](float t) { return t; }},
    {"linear_r", [](float t) { return 1 - t; }},
    {"sigmoid",
     [](float t) {
       auto const s = [](float x) { return 1 / (1 + std::exp(-12 * (x - 0.5f))); };
       return (s(t) - s(0)) / (s(1) - s(0));
     }},
    {"geom", [](float t) { return (std::exp2(8 * t) - 1) / 255; }},
    {"geom_r", [](float t) { return (std::exp2(8 * (1 - t)) - 1) / 255; }},
    {"constant", [](float) { return 1.0f; }},
};

} // namespace

std::vector<std::string> opacityNames() {
  std::vector<std::string> names;
  for (Named const& n : kShapes) names.emplace_back(n.name);
  return names;
}

Transfer::Transfer(TransferOptions const& options) {
  if (!(options.low < options.high) || !std::isfinite(options.low) || !std::isfinite(options.high))
    throw std::invalid_argument("the range must begin below its end");
  if (options.log && !(options.low > 0))
    throw std::invalid_argument("a range for logarithms must begin above 0");
  std::array<Vec3, 256> colors;
  if (!colorMap(options.colors, colors))
    throw std::invalid_argument("there are no colours '" + options.colors + "'");
  m_view.isLog = options.log;
  m_view.low = options.log ? std::log(options.low) : options.low;
  float const high = options.log ? std::log(options.high) : options.high;
  m_view.scale = 1 / (high - m_view.low);
  if (!std::isfinite(m_view.scale) || m_view.scale == 0)
    throw std::invalid_argument("the range is too narrow or too wide");

  auto const* const named = std::find_if(std::begin(kShapes), std::end(kShapes),
                                         [&](Named const& n) { return options.opacity == n.name; });
  bool const isNamed = named != std::end(kShapes);
  Points const points = isNamed ? Points() : pointsOf(options.opacity);
  float const farthest =
      std::max(std::abs(options.low - options.from), std::abs(options.high - options.from));
  for (int n = 0; n < kTransferSize; ++n) {
    float const t = static_cast<float>(n) / (kTransferSize - 1);
    float const in = m_view.low + t / m_view.scale, value = options.log ? std::exp(in) : in;
    m_view.color[n] = colors[n];
    m_view.opacity[n] = !isNamed ? between(points, value)
                        : options.awayFrom
                            ? named->shape(std::min(1.0f, std::abs(value - options.from) / farthest))
                            : named->shape(t);
  }
  keepExtremes(m_view, points);
  std::copy_n(m_view.opacity, kTransferSize, m_largest[0].begin());
  for (std::size_t n = 1; n < m_largest.size(); ++n)
    for (std::size_t i = 0; i + (std::size_t(1) << n) <= kTransferSize; ++i)
      m_largest[n][i] = std::max(m_largest[n - 1][i], m_largest[n - 1][i + (std::size_t(1) << (n - 1))]);
}

float Transfer::largestOpacity(float low, float high) const {
  auto const first = static_cast<std::size_t>(m_view.place(low) * (kTransferSize - 1));
  auto const last = std::min<std::size_t>(
      static_cast<std::size_t>(std::ceil(m_view.place(high) * (kTransferSize - 1))), kTransferSize - 1);
  std::size_t const count = std::max(last, first) - first + 1;
  auto const level = static_cast<std::size_t>(std::bit_width(count >> 1));
  return std::max(m_largest[level][first], m_largest[level][first + count - (std::size_t(1) << level)]);
}

} // namespace VLN::Render
