#include "Drawing.h"

#include "Interop/FileFormat.h"

#include <algorithm>
#include <cmath>
#include <stdexcept>

#include <fmt/format.h>

namespace Vln {

using namespace VLN::Interop;
using namespace VLN::Render;

namespace {

// Of the values, sorted, that a field holds.
float quantile(std::vector<float> const& sorted, double share) {
  return sorted.empty() ? 0.0f : sorted[static_cast<std::size_t>(share * double(sorted.size() - 1))];
}

// As a level set has it: nearer to zero than the background, with both signs.
bool isBand(Field const& field) { return field.background() > 0 && field.low() < 0 && field.high() > 0; }

// What was not asked for follows from the field.
void choose(Field const& field, RenderSource const& source, RenderCommandOptions const& options,
            RenderOptions& r) {
  // A flat buffer knows no fogs of its own.
  std::string const& gridClass = source.gridClass;
  bool const isFog = gridClass == "fog volume" || (gridClass.empty() && source.channel == "density");
  RenderMode const mode =
      options.mode  ? *options.mode
      : options.iso ? RenderMode::kIsosurface
      : !isFog && (isBand(field) || (gridClass == "level set" && field.low() < 0 && field.high() > 0))
          ? RenderMode::kSurface
          : RenderMode::kFog;
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
  case RenderMode::kFog:
    r.mode = Mode::kFog;
    break;
  case RenderMode::kSurface:
    r.mode = Mode::kSurface;
    r.iso = static_cast<float>(options.iso.value_or(0));
    break;
  case RenderMode::kIsosurface:
    r.mode = Mode::kSurface;
    r.iso = options.iso ? static_cast<float>(*options.iso) : 0.5f * (low + high);
    break;
  case RenderMode::kMaximum:
    r.mode = Mode::kMaximum;
    break;
  case RenderMode::kMean:
    r.mode = Mode::kMean;
    break;
  }
  if (r.mode == Mode::kSurface && !(field.low() <= r.iso && r.iso <= field.high()))
    throw std::invalid_argument(
        fmt::format("no surface: its values lie in {:.6g} .. {:.6g}, and none is {:.6g}", field.low(),
                    field.high(), r.iso));
  r.depth = options.depth;
}

} // namespace

Drawing::Drawing(RenderCommandOptions const& options, std::string const& channel, Progress const& progress)
    : m_options(options)
    , m_source(renderSource(options.file, channel, options.limits, progress))
    , m_render(options.render) {
  if (m_source.points) {
    for (auto const& p : m_source.points->positions) m_outline.push_back(p);
    m_margin = m_source.points->radius;
    return;
  }
  m_field.emplace(m_source.grid, FieldOptions{options.component, options.render.threads, m_source.bounds});
  if (m_field->empty()) throw std::invalid_argument("channel '" + m_source.channel + "' has no active voxel");
  choose(*m_field, m_source, options, m_render);
  auto const shows = [&](float low, float high) {
    if (m_render.mode == Mode::kSurface) return low < m_render.iso && high >= m_render.iso;
    return low != m_field->background() || high != m_field->background();
  };
  for (Vec3 const& p : m_field->outline(shows))
    m_outline.push_back(m_source.tileToWorld.point(p.as<double>() + m_field->origin()));
  for (int a = 0; a < 3; ++a) m_margin = std::max(m_margin, 0.5 * m_source.tileToWorld.edge(a));
}

Camera Drawing::camera(double azimuth, double aspect) const {
  CameraOptions camera = m_options.camera;
  camera.azimuth += azimuth;
  // A cloud of points from above is a map: its third axis points up.
  if (!camera.viewUp && formatOf(m_options.file) == FileFormat::kPly) camera.viewUp = Vec3d{0, 0, 1};
  return Camera(camera, m_outline, m_margin, aspect);
}

RenderedFrame Drawing::frame(double azimuth, std::function<void(double)> const& watch) {
  RenderedFrame frame;
  frame.camera = camera(azimuth, double(m_render.width) / m_render.height);
  frame.channel = m_source.channel;
  frame.options = m_render;
  if (m_source.points) {
    frame.picture = renderPoints(*m_source.points, frame.camera, m_render.width, m_render.height);
    return frame;
  }
  frame.picture = VLN::Render::render(*m_field, m_source.tileToWorld, frame.camera, m_render, watch);
  // What was chosen for the first frame holds for all.
  m_render.opacityUnit = frame.options.opacityUnit = frame.picture.opacityUnit;
  frame.hasColors = m_render.mode != Mode::kSurface && (m_render.mode != Mode::kFog || m_render.colored);
  if (m_render.mode == Mode::kMaximum || m_render.mode == Mode::kMean) {
    m_render.transfer.low = frame.picture.low, m_render.transfer.high = frame.picture.high;
    m_render.rangeFromPicture = false;
    frame.options.transfer = m_render.transfer;
  }
  return frame;
}

} // namespace Vln
