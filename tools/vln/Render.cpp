#include "Interop/FileError.h"
#include "Interop/FileFormat.h"
#include "ProgressBar.h"
#include "RenderCommand.h"
#include "RenderSource.h"
#include "StandardOutput.h"

#include <algorithm>
#include <cmath>
#include <filesystem>
#include <iostream>
#include <ostream>
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

// name.png, frame 3: name_0003.png
std::string frameName(std::string const& path, int frame, int frames) {
  if (frames == 0) return path;
  std::filesystem::path const p(path);
  return (p.parent_path() / fmt::format("{}_{:04}{}", p.stem().string(), frame, p.extension().string()))
      .string();
}

class Drawing {
public:
  Drawing(RenderCommandOptions const& options, ProgressBar& bar)
      : m_options(options)
      , m_source(renderSource(options.file, options.channel, options.limits, bar.progress(0, 0.5)))
      , m_progress(bar.progress(0.5, 1)) {
    m_render = options.render;
    if (m_source.points) {
      for (auto const& p : m_source.points->positions) m_outline.push_back(p);
      m_margin = m_source.points->radius;
      return;
    }
    m_field.emplace(m_source.grid, FieldOptions{options.component, options.render.threads});
    if (m_field->empty())
      throw std::invalid_argument("channel '" + m_source.channel + "' has no active voxel");
    choose(*m_field, m_source, options, m_render);
    auto const shows = [&](float low, float high) {
      if (m_render.mode == Mode::kSurface) return low < m_render.iso && high >= m_render.iso;
      return low != m_field->background() || high != m_field->background();
    };
    for (Vec3 const& p : m_field->outline(shows))
      m_outline.push_back(m_source.tileToWorld.point(p.as<double>() + m_field->origin()));
    for (int a = 0; a < 3; ++a) m_margin = std::max(m_margin, 0.5 * m_source.tileToWorld.edge(a));
  }

  RenderSource const& source() const { return m_source; }

  RenderedFrame frame(double azimuth, double from, double to) {
    RenderedFrame frame;
    CameraOptions camera = m_options.camera;
    camera.azimuth += azimuth;
    // A cloud of points from above is a map: its third axis points up.
    if (!camera.viewUp && formatOf(m_options.file) == FileFormat::kPly) camera.viewUp = Vec3d{0, 0, 1};
    frame.camera = Camera(camera, m_outline, m_margin, double(m_render.width) / m_render.height);
    frame.channel = m_source.channel;
    frame.options = m_render;
    if (m_source.points) {
      frame.picture = renderPoints(*m_source.points, frame.camera, m_render.width, m_render.height);
    } else {
      frame.picture =
          VLN::Render::render(*m_field, m_source.tileToWorld, frame.camera, m_render, [&](double done) {
            if (m_progress) m_progress("drawing", from + (to - from) * done);
          });
      // What was chosen for the first frame holds for all.
      m_render.opacityUnit = frame.options.opacityUnit = frame.picture.opacityUnit;
      frame.hasColors = m_render.mode != Mode::kSurface && (m_render.mode != Mode::kFog || m_render.colored);
      if (m_render.mode == Mode::kMaximum || m_render.mode == Mode::kMean) {
        m_render.transfer.low = frame.picture.low, m_render.transfer.high = frame.picture.high;
        m_render.rangeFromPicture = false;
        frame.options.transfer = m_render.transfer;
      }
    }
    return frame;
  }

private:
  RenderCommandOptions const& m_options;
  RenderSource m_source;
  std::optional<Field> m_field;
  RenderOptions m_render;
  std::vector<Vec3d> m_outline;
  double m_margin = 0;
  Progress m_progress;
};

} // namespace

void render(RenderCommandOptions const& options) {
  std::string const output =
      options.output.empty() ? std::filesystem::path(options.file).stem().string() + ".png" : options.output;
  checkOutputFor(FileContent::kRenderings, output);
  if (options.turntable > 0 && formatOf(output) == FileFormat::kUnknown)
    throw FileError(output, "several pictures are written as .exr or .png files");
  if (!options.parameters.empty()) checkOutputFor(FileContent::kParameters, options.parameters);
  checkBackground(options.background);
  TransferOptions early; // what is wrong with the opacity is told before the file is read
  early.opacity = options.render.transfer.opacity;
  Transfer const unused(early);
  std::string summary, note;
  {
    ProgressBar bar;
    try {
      Drawing drawing(options, bar);
      note = drawing.source().note;
      int const frames = std::max(1, options.turntable);
      for (int n = 0; n < frames; ++n) {
        auto const frame = drawing.frame(360.0 * n / frames, double(n) / frames, (n + 1.0) / frames);
        std::string const path = frameName(output, n + 1, options.turntable);
        writeFrame(path, frame, options);
        if (n > 0) continue;
        if (!options.parameters.empty()) writeParameters(options.parameters, path, frame, options);
        summary = fmt::format("{}: {}, {} x {} pixels, {:.2f} s\n", path,
                              frame.channel.empty() ? "points" : oneLine(frame.channel, 60),
                              frame.picture.width, frame.picture.height, frame.picture.seconds);
        if (frame.options.mode == Mode::kFog && !frame.channel.empty())
          summary +=
              fmt::format("fog: --clim {:.6g},{:.6g} --opacity-unit {:.6g}\n", frame.options.transfer.low,
                          frame.options.transfer.high, frame.picture.opacityUnit);
        else if (frame.hasColors)
          summary += fmt::format("colours: --clim {:.6g},{:.6g}\n", frame.picture.low, frame.picture.high);
        else if (frame.options.mode == Mode::kSurface && frame.options.iso != 0)
          summary += fmt::format("surface: --iso {}\n", frame.options.iso);
        summary += "camera: " + cameraText(frame.camera) + "\n";
      }
    } catch (std::invalid_argument const& error) { throw FileError(options.file, error.what()); }
  }
  // Beside neither the picture nor the parameters where one of them is standard output.
  bool const beside = &remarks(options.parameters.empty() ? output : options.parameters) == &std::cerr;
  (beside ? std::cerr : remarks(output)) << summary;
  if (!note.empty()) std::cerr << fmt::format("vln: {}: note: {}\n", options.file, note);
}

} // namespace Vln
