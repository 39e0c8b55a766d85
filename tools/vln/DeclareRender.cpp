#include "Declare.h"
#include "Render/Colors.h"
#include "Render/Transfer.h"
#include "RenderCommand.h"

#include <CLI/CLI.hpp>

#include <charconv>
#include <cmath>
#include <map>
#include <memory>

namespace Vln {

using VLN::Render::Vec3d;

namespace {

// Numbers between commas, as many as that.
std::vector<double> numbers(std::string const& text, std::size_t count) {
  std::vector<double> values;
  for (std::size_t at = 0; at <= text.size();) {
    std::size_t const end = std::min(text.find(',', at), text.size());
    double v = 0;
    auto const [stop, error] = std::from_chars(text.data() + at, text.data() + end, v);
    if (error != std::errc() || stop != text.data() + end || !std::isfinite(v)) break;
    values.push_back(v);
    at = end + 1;
    if (end == text.size()) return values.size() == count ? values : std::vector<double>();
  }
  return {};
}

std::optional<Vec3d> vectorOf(std::string const& text) {
  static std::map<std::string, Vec3d> const names{{"x", {1, 0, 0}},   {"y", {0, 1, 0}},   {"z", {0, 0, 1}},
                                                  {"+x", {1, 0, 0}},  {"+y", {0, 1, 0}},  {"+z", {0, 0, 1}},
                                                  {"-x", {-1, 0, 0}}, {"-y", {0, -1, 0}}, {"-z", {0, 0, -1}}};
  if (auto const it = names.find(text); it != names.end()) return it->second;
  auto const v = numbers(text, 3);
  if (v.empty()) return {};
  return Vec3d{v[0], v[1], v[2]};
}

template <class Set>
void addVector(CLI::App& self, char const* name, char const* help, bool isDirection, Set set) {
  self.add_option_function<std::string>(
          name,
          [=](std::string const& text) {
            auto const v = vectorOf(text);
            if (!v) throw CLI::ValidationError(name, text + " is no vector, such as 1,-2,0.5");
            if (isDirection && !(VLN::Render::length(*v) > 0))
              throw CLI::ValidationError(name, text + " has no length");
            set(*v);
          },
          help)
      ->type_name(isDirection ? "X,Y,Z|x|-x|y|..." : "X,Y,Z");
}

void addCamera(CLI::App& self, VLN::Render::CameraOptions& c) {
  std::string const group = "Camera";
  self.option_defaults()->group(group);
  addVector(self, "--camera-direction", "Direction of view (default: from three quarters)", true,
            [&c](Vec3d v) { c.direction = v; });
  addVector(self, "--camera-position", "Where it stands (default: as near as shows everything)", false,
            [&c](Vec3d v) { c.position = v; });
  addVector(self, "--camera-focal-point", "What it looks at (default: the middle)", false,
            [&c](Vec3d v) { c.focalPoint = v; });
  addVector(self, "--camera-view-up", "What is up (default: y; z for .ply files)", true,
            [&c](Vec3d v) { c.viewUp = v; });
  finite(self.add_option("--camera-view-angle", c.viewAngle, "Degrees from the lower edge to the upper one"))
      ->check(CLI::Range(0.01, 170.0))
      ->capture_default_str()
      ->type_name("DEGREES");
  finite(self.add_option("--camera-zoom-factor", c.zoom, "Shows that much less, larger"))
      ->check(CLI::Range(1e-3, 1e6))
      ->capture_default_str()
      ->type_name("F");
  finite(self.add_option("--camera-azimuth-angle", c.azimuth,
                         "Degrees that it then turns about the up direction"))
      ->type_name("DEGREES");
  finite(self.add_option("--camera-elevation-angle", c.elevation, "Degrees that it then goes up"))
      ->type_name("DEGREES");
  self.option_defaults()->group("Options");
}

} // namespace

void declareRender(CLI::App& self) {
  using VLN::Render::Quality;
  auto const options = std::make_shared<RenderCommandOptions>();
  auto& o = *options;
  self.add_option("FILE", o.file, inputFile(VLN::Interop::FileContent::kVolumes))->required();
  self.add_option(
          "-o,--output", o.output,
          "The picture, .png, or .exr with depth and normals (default: the name of FILE with .png, here)")
      ->type_name("OUT");
  self.add_option("--channel", o.channel,
                  "Name of the channel, as info tells it (default: density, or the first)")
      ->type_name("NAME");
  self.add_option_function<std::string>(
          "--component", [&o](std::string const& c) { o.component = c == "length" ? -1 : c[0] - 'x'; },
          "Of vectors: x, y, z, or their length (the default)")
      ->check(CLI::IsMember({"x", "y", "z", "length"}))
      ->type_name("C");
  static std::map<std::string, RenderMode> const modes{{"fog", RenderMode::kFog},
                                                       {"surface", RenderMode::kSurface},
                                                       {"mip", RenderMode::kMaximum},
                                                       {"mean", RenderMode::kMean},
                                                       {"isosurface", RenderMode::kIsosurface}};
  self.add_option("--mode", o.mode,
                  "What is drawn (default: fog or surface, as the channel's class and values say)")
      ->transform(CLI::CheckedTransformer(modes, CLI::ignore_case))
      ->type_name("fog|surface|mip|mean|isosurface");
  finite(self.add_option("--iso", o.iso, "Value on the surface"))->type_name("V");
  static std::map<std::string, Quality> const qualities{{"preview", Quality::kPreview},
                                                        {"final", Quality::kFinal}};
  self.add_option("--quality", o.render.quality, "A quick picture, or one without bias")
      ->transform(CLI::CheckedTransformer(qualities, CLI::ignore_case))
      ->default_str("preview")
      ->type_name("preview|final");
  self.add_option("--spp", o.render.samples, "Samples for each pixel (default: by mode and quality)")
      ->check(CLI::Range(1, 1 << 20))
      ->type_name("N");
  finite(
      self.add_option("--time-limit", o.render.timeLimit, "Seconds after which no further sample is begun"))
      ->check(CLI::Range(1e-3, 1e9))
      ->type_name("S");
  self.add_option("--cmap", o.colors, "Colours (default: viridis; fogs of density are white)")
      ->check(CLI::IsMember(VLN::Render::colorMapNames()))
      ->type_name("NAME");
  self.add_option_function<std::string>(
          "--clim",
          [&o](std::string const& text) {
            auto const v = numbers(text, 2);
            if (v.empty() || !(v[0] < v[1]))
              throw CLI::ValidationError("--clim", text + " is no range, such as 0,1.5");
            o.range = {v[0], v[1]};
          },
          "Values of the first and the last colour (default: what 99 of 100 values lie in)")
      ->type_name("LOW,HIGH");
  self.add_flag("--log", o.render.transfer.log, "Colours and opacity by the logarithm of the value");
  self.add_option("--opacity", o.render.transfer.opacity,
                  "linear, linear_r, sigmoid, geom, geom_r, constant, or values with opacities")
      ->capture_default_str()
      ->type_name("NAME|V:A,V:A,...");
  finite(
      self.add_option("--opacity-unit", o.render.opacityUnit,
                      "World length over which opacity 1 lets 1/e of the light pass (default: by the field)"))
      ->check(CLI::Range(1e-30, 1e30))
      ->type_name("LENGTH");
  addVector(self, "--light", "Direction to the light (default: above the camera, to the left)", true,
            [&o](Vec3d v) { o.render.light = v; });
  self.add_option_function<std::string>(
          "--size",
          [&o](std::string const& text) {
            int w = 0, h = 0;
            char const* const end = text.data() + text.size();
            auto const first = std::from_chars(text.data(), end, w);
            bool ok = first.ec == std::errc() && first.ptr != end && *first.ptr == 'x';
            if (ok) {
              auto const second = std::from_chars(first.ptr + 1, end, h);
              ok = second.ec == std::errc() && second.ptr == end;
            }
            if (!ok || w < 1 || h < 1 || w > 16384 || h > 16384)
              throw CLI::ValidationError("--size",
                                         text + " is no size of 1x1 to 16384x16384, such as 1920x1080");
            o.render.width = w, o.render.height = h;
          },
          "Pixels")
      ->default_str("1024x1024")
      ->type_name("WxH");
  self.add_option("--background", o.background, "neutral, none (opacity is kept), white, black or #rrggbb")
      ->capture_default_str()
      ->type_name("COLOR");
  self.add_flag("--scalar-bar", o.scalarBar, "Also what the colours stand for");
  self.add_flag("--axes", o.axes, "Also the directions of the axes");
  self.add_option("--turntable", o.turntable, "So many pictures from all round: OUT_0001.png, ...")
      ->check(CLI::Range(1, 9999))
      ->type_name("N");
  self.add_option("--depth", o.depth,
                  "Draw no tile deeper than this (default: where samples are about as wide as a pixel)")
      ->check(CLI::Range(0, 28))
      ->type_name("D");
  self.add_option("--parameters", o.parameters, "Also all parameters of the picture")->type_name("OUT.json");
  self.add_option("--threads", o.render.threads, "Threads (default: one for each processor)")
      ->check(CLI::Range(1, 1024))
      ->type_name("N");
  addCamera(self, o.camera);
  addMemoryLimit(self, o.limits);
  self.callback([options] { render(*options); });
}

} // namespace Vln
