#include "Commands.h"
#include "Interop/FileError.h"
#include "Interop/FileFormat.h"
#include "Interop/Picture.h"
#include "ProgressBar.h"
#include "RenderCommand.h"
#include "RenderSource.h"
#include "StandardOutput.h"

#include "Render/Colors.h"

#include <cmath>
#include <filesystem>
#include <ostream>
#include <stdexcept>

#include <fmt/format.h>

namespace Vln {

using namespace VLN::Interop;
using namespace VLN::Render;

namespace {

std::string text(Vec3d v) { return fmt::format("{:.9g},{:.9g},{:.9g}", v.x, v.y, v.z); }

// Whether values of both signs lie round a surface.
bool hasSurface(Field const& field) { return field.background() > 0 && field.low() < 0 && field.high() > 0; }

} // namespace

void render(RenderCommandOptions const& options) {
  std::string const output =
      options.output.empty() ? std::filesystem::path(options.file).stem().string() + ".png" : options.output;
  checkOutputAs(output, "pictures", {FileFormat::kPng});
  std::string summary;
  {
    ProgressBar bar;
    auto const source = renderSource(options.file, options.channel, options.limits, bar.progress(0, 0.5));
    try {
      Field field(source.grid, {options.component, options.threads});
      if (field.empty()) throw FileError(options.file, "channel '" + source.channel + "' has no active voxel");
      RenderOptions r = options.render;
      r.threads = options.threads;
      if (!options.mode) r.mode = source.gridClass == "level set" && hasSurface(field) ? Mode::kSurface
                                  : source.gridClass != "fog volume" && hasSurface(field) ? Mode::kSurface
                                                                                           : Mode::kFog;
      else r.mode = *options.mode;
      auto const values = field.sortedValues(1 << 18);
      if (!options.range) {
        auto const quantile = [&](double q) {
          return values.empty() ? 0.0f : values[static_cast<std::size_t>(q * double(values.size() - 1))];
        };
        float low = quantile(0.005), high = quantile(0.995);
        if (field.background() == 0 && low > 0) low = 0;
        if (!(low < high)) low = std::min(low, high) - 0.5f, high = low + 1;
        r.transfer.low = low, r.transfer.high = high;
        r.rangeFromPicture = true;
      }
      float const background = field.background();
      if (background > r.transfer.low) r.transfer.awayFrom = true, r.transfer.from = background;
      Vec3d low, high;
      for (int corner = 0; corner < 8; ++corner) {
        Vec3d p = field.origin();
        for (int a = 0; a < 3; ++a)
          p[a] += corner >> a & 1 ? double(field.activeHigh()[a]) + 0.5 : double(field.activeLow()[a]) - 0.5;
        p = source.tileToWorld.point(p);
        for (int a = 0; a < 3; ++a) {
          low[a] = corner == 0 ? p[a] : std::min(low[a], p[a]);
          high[a] = corner == 0 ? p[a] : std::max(high[a], p[a]);
        }
      }
      Camera const camera(options.camera, low, high, double(r.width) / r.height);
      auto const progress = bar.progress(0.5, 1);
      auto const picture = VLN::Render::render(field, source.tileToWorld, camera, r, [&](double done) {
        if (progress) progress("drawing", done);
        return true;
      });
      writeRgbaPng(output, r.width, r.height, toBytes(picture, fromSrgb(0x6b727a), true));
      summary = fmt::format("{}: {} in {:.3f} s, {} samples a pixel, unit {:.4g}, range {:.6g},{:.6g}\n", output, source.channel,
                            picture.seconds, picture.samples, picture.opacityUnit, picture.low, picture.high);
      summary += fmt::format("camera: --camera-position {} --camera-focal-point {} --camera-view-up {} "
                             "--camera-view-angle {:.9g}\n",
                             text(camera.position), text(camera.focalPoint), text(camera.viewUp), camera.viewAngle);
    } catch (std::invalid_argument const& error) { throw FileError(options.file, error.what()); }
  }
  remarks(output) << summary;
}

} // namespace Vln
