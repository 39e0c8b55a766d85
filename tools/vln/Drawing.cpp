#include "Drawing.h"

#include "Interop/FileFormat.h"

#include <algorithm>
#include <stdexcept>

namespace Vln {

using namespace VLN::Interop;
using namespace VLN::Render;

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
  chooseLook(*m_field,
             {m_source.channel, m_source.gridClass, options.mode, options.iso, options.range, options.colors,
              options.depth},
             m_render);
  m_outline = outlineOf(*m_field, m_source.tileToWorld, m_render);
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
