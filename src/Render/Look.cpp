#include "Render/Look.h"

#include <algorithm>
#include <cmath>
#include <cstdio>
#include <stdexcept>

namespace VLN::Render {

namespace {

// Of the values, sorted, that a field holds.
float quantile(std::vector<float> const& sorted, double share) {
  return sorted.empty() ? 0.0f : sorted[share * double(sorted.size() - 1)];
}

// As a level set has it: nearer to zero than the background, with both signs.
bool isBand(Field const& field) { return field.background() > 0 && field.low() < 0 && field.high() > 0; }

} // namespace

void chooseLook(Field const& field, LookHints const& options, RenderOptions& r) {
  // A flat buffer knows no fogs of its own.
  std::string const& gridClass = options.gridClass;
  bool const isFog = gridClass == "fog volume" || (gridClass.empty() && options.channel == "density");
  LookMode const mode =
      options.mode  ? *options.mode
      : options.iso ? LookMode::kIsosurface
      : !isFog && (isBand(field) || (gridClass == "level set" && field.low() < 0 && field.high() > 0))
          ? LookMode::kSurface
          : LookMode::kFog;
  auto const values = field.sortedValues(std::size_t(1) << 18);
  float low = quantile(values, 0.005), high = quantile(values, 0.995);
  if (field.background() == 0 && low > 0) low = 0;
  if (field.background() == 0 && high < 0) high = 0;
  if (r.transfer.log && !(low > 0)) low = high > 0 ? high * 1e-3f : 1e-3f;
  if (!(low < high)) {
    float const by = std::max(0.5f, std::abs(low) * 1e-3f);
    low -= r.transfer.log ? 0.5f * low : by, high = low + 2 * by;
  }
  r.rangeFromPicture = !options.range;
  r.transfer.low = options.range ? static_cast<float>(options.range->first) : low;
  r.transfer.high = options.range ? static_cast<float>(options.range->second) : high;
  r.transfer.colors = options.colors.empty() ? "viridis" : options.colors;
  r.colored = !options.colors.empty() || !isFog;
  // Where the background is not the lowest value, what differs from it is what there is to see.
  float const background = field.background();
  if (!(background <= r.transfer.low) && std::isfinite(background))
    r.transfer.awayFrom = true, r.transfer.from = background;
  switch (mode) {
  case LookMode::kFog:
    r.mode = Mode::kFog;
    break;
  case LookMode::kSurface:
    r.mode = Mode::kSurface;
    r.iso = static_cast<float>(options.iso.value_or(0));
    break;
  case LookMode::kIsosurface:
    r.mode = Mode::kSurface;
    r.iso = options.iso ? static_cast<float>(*options.iso) : 0.5f * (low + high);
    break;
  case LookMode::kMaximum:
    r.mode = Mode::kMaximum;
    break;
  case LookMode::kMean:
    r.mode = Mode::kMean;
    break;
  }
  if (r.mode == Mode::kSurface && !(field.low() <= r.iso && r.iso <= field.high())) {
    char text[160];
    std::snprintf(text, sizeof text, "no surface: its values lie in %.6g .. %.6g, and none is %.6g",
                  double(field.low()), double(field.high()), double(r.iso));
    throw std::invalid_argument(text);
  }
  r.depth = options.depth;
}

std::vector<Vec3d> outlineOf(Field const& field, Affine const& tileToWorld, RenderOptions const& options) {
  auto const shows = [&](float low, float high) {
    if (options.mode == Mode::kSurface) return low < options.iso && high >= options.iso;
    return low != field.background() || high != field.background();
  };
  std::vector<Vec3d> outline;
  for (Vec3 const& p : field.outline(shows))
    outline.push_back(tileToWorld.point(p.as<double>() + field.origin()));
  return outline;
}

} // namespace VLN::Render
