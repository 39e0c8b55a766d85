#include "Interop/Exr.h"
#include "Interop/FileFormat.h"
#include "Interop/Image.h"
#include "Interop/OutputFile.h"
#include "Interop/Picture.h"
#include "Render/Colors.h"
#include "RenderCommand.h"

#include <algorithm>
#include <charconv>
#include <cmath>
#include <numeric>
#include <stdexcept>

#include <fmt/format.h>
#include <nlohmann/json.hpp>

namespace Vln {

using namespace VLN::Interop;
using namespace VLN::Render;

namespace {

struct Background {
  std::uint32_t rgb = 0x6b727a; // between what is lit and what is dark
  bool isNone = false;
};

Background backgroundOf(std::string const& text) {
  if (text == "neutral") return {};
  if (text == "none") return {0, true};
  if (text == "white") return {0xffffff, false};
  if (text == "black") return {0, false};
  std::uint32_t rgb = 0;
  char const* const end = text.data() + text.size();
  if (text.size() == 7 && text[0] == '#')
    if (auto const [at, error] = std::from_chars(text.data() + 1, end, rgb, 16);
        error == std::errc() && at == end)
      return {rgb, false};
  throw std::invalid_argument("'" + text + "' is no background: neutral, none, white, black or #rrggbb");
}

// Lines and letters over the bytes of a picture.
class Overlay {
public:
  Overlay(std::vector<std::uint8_t>& bytes, int width, int height)
      : m_bytes(bytes)
      , m_width(width)
      , m_height(height)
      , m_scale(std::max(1, std::min(width, height) / 400)) {}

  int scale() const { return m_scale; }
  void dot(int x, int y, Rgb c) {
    if (x < 0 || y < 0 || x >= m_width || y >= m_height) return;
    auto const at =
        4 * (static_cast<std::size_t>(y) * static_cast<std::size_t>(m_width) + static_cast<std::size_t>(x));
    m_bytes[at] = c.r, m_bytes[at + 1] = c.g, m_bytes[at + 2] = c.b, m_bytes[at + 3] = 255;
  }
  void box(int x, int y, int width, int height, Rgb c) {
    for (int j = 0; j < height; ++j)
      for (int i = 0; i < width; ++i) dot(x + i, y + j, c);
  }
  void line(double x0, double y0, double x1, double y1, Rgb c) {
    int const steps = 1 + static_cast<int>(2 * std::hypot(x1 - x0, y1 - y0));
    for (int n = 0; n <= steps; ++n)
      box(static_cast<int>(std::lround(x0 + (x1 - x0) * n / steps)) - m_scale / 2,
          static_cast<int>(std::lround(y0 + (y1 - y0) * n / steps)) - m_scale / 2, m_scale, m_scale, c);
  }
  // White letters on a dark rim are read on every ground.
  void text(int x, int y, std::string const& letters, Rgb c = {255, 255, 255}) {
    Image paper(Image::textWidth(letters, m_scale), Image::textHeight(m_scale), {0, 0, 0});
    paper.text(0, 0, letters, {255, 255, 255}, m_scale);
    for (bool isRim : {true, false})
      for (int j = 0; j < paper.height(); ++j)
        for (int i = 0; i < paper.width(); ++i)
          if (paper(i, j).r) {
            if (isRim)
              box(x + i - m_scale, y + j - m_scale, 2 * m_scale + 1, 2 * m_scale + 1, {30, 30, 30});
            else
              dot(x + i, y + j, c);
          }
  }
  void scalarBar(RenderedFrame const& frame) {
    TransferOptions options = frame.options.transfer;
    options.low = frame.picture.low, options.high = frame.picture.high;
    Transfer const transfer(options);
    int const height = m_height / 2, width = 10 * m_scale, x = m_width - width - 70 * m_scale,
              top = (m_height - height) / 2;
    for (int j = 0; j < height; ++j) {
      Vec3 const c =
          transfer.view().colorAt(1 - static_cast<float>(j) / static_cast<float>(std::max(1, height - 1)));
      box(x, top + j, width, 1, {toSrgbByte(c.x), toSrgbByte(c.y), toSrgbByte(c.z)});
    }
    for (int n = 0; n <= 4; ++n) {
      double const t = n / 4.0;
      double const v = options.log
                           ? double(options.low) * std::pow(double(options.high) / double(options.low), t)
                           : double(options.low) + (double(options.high) - double(options.low)) * t;
      int const y = top + static_cast<int>(std::lround((1 - t) * (height - 1)));
      box(x + width, y, 3 * m_scale, m_scale, {255, 255, 255});
      text(x + width + 5 * m_scale, y - Image::textHeight(m_scale) / 2, fmt::format("{:.4g}", v));
    }
  }
  void axes(Camera const& camera) {
    double const size = 0.07 * std::min(m_width, m_height), x = 1.6 * size, y = m_height - 1.6 * size;
    // Those that point away first.
    int order[3] = {0, 1, 2};
    std::sort(order, order + 3, [&](int a, int b) { return camera.forward[a] > camera.forward[b]; });
    constexpr Rgb colors[3] = {{226, 74, 74}, {110, 196, 84}, {86, 140, 244}};
    for (int a : order) {
      double const dx = camera.right[a], dy = -camera.up[a];
      line(x, y, x + size * dx, y + size * dy, colors[a]);
      text(static_cast<int>(x + 1.25 * size * dx) - 2 * m_scale,
           static_cast<int>(y + 1.25 * size * dy) - 3 * m_scale, std::string(1, "XYZ"[a]), colors[a]);
    }
  }

private:
  std::vector<std::uint8_t>& m_bytes;
  int m_width, m_height, m_scale;
};

std::string vectorText(Vec3d v) { return fmt::format("{},{},{}", v.x, v.y, v.z); }

void writeLight(std::string const& path, Picture const& p) {
  std::vector<float> parts[6];
  for (auto& part : parts) part.reserve(p.color.size());
  for (std::size_t n = 0; n < p.color.size(); ++n)
    for (int a = 0; a < 3; ++a) {
      parts[a].push_back(p.color[n][a]);
      parts[3 + a].push_back(p.normal[n][a]);
    }
  std::vector<ExrChannel> channels{{"R", &parts[0]},   {"G", &parts[1]},   {"B", &parts[2]},
                                   {"A", &p.opacity},  {"N.X", &parts[3]}, {"N.Y", &parts[4]},
                                   {"N.Z", &parts[5]}, {"Z", &p.depth}};
  writeExr(path, p.width, p.height, channels);
}

} // namespace

std::string cameraText(Camera const& camera) {
  return fmt::format(
      "--camera-position {} --camera-focal-point {} --camera-view-up {} --camera-view-angle {}",
      vectorText(camera.position), vectorText(camera.focalPoint), vectorText(camera.viewUp),
      camera.viewAngle);
}

void checkBackground(std::string const& background) { backgroundOf(background); }

void writeFrame(std::string const& path, RenderedFrame const& frame, RenderCommandOptions const& options) {
  auto const& p = frame.picture;
  if (formatOf(path) == FileFormat::kExr) {
    writeLight(path, p);
    return;
  }
  Background const background = backgroundOf(options.background);
  auto bytes = toBytes(p, fromSrgb(background.rgb), !background.isNone);
  Overlay overlay(bytes, p.width, p.height);
  if (options.scalarBar && frame.hasColors) overlay.scalarBar(frame);
  if (options.axes) overlay.axes(frame.camera);
  writeRgbaPng(path, p.width, p.height, bytes);
}

void writeParameters(std::string const& path, std::string const& picture, RenderedFrame const& frame,
                     RenderCommandOptions const& options) {
  auto const vector = [](Vec3d v) { return nlohmann::ordered_json{v.x, v.y, v.z}; };
  auto const& r = frame.options;
  nlohmann::ordered_json json;
  json["picture"] = picture;
  json["file"] = options.file;
  json["channel"] = frame.channel;
  json["size"] = {frame.picture.width, frame.picture.height};
  json["samples"] = frame.picture.samples;
  json["seconds"] = frame.picture.seconds;
  json["samples_asked"] = r.samples;
  json["time_limit"] = r.timeLimit;
  json["background"] = options.background;
  json["scalar_bar"] = options.scalarBar;
  json["axes"] = options.axes;
  json["turntable"] = options.turntable;
  json["camera"] = {{"position", vector(frame.camera.position)},
                    {"focal_point", vector(frame.camera.focalPoint)},
                    {"view_up", vector(frame.camera.viewUp)},
                    {"view_angle", frame.camera.viewAngle}};
  if (!frame.channel.empty()) {
    constexpr char const* modes[] = {"fog", "surface", "mip", "mean"};
    json["mode"] = modes[static_cast<int>(r.mode)];
    json["quality"] = r.quality == Quality::kFinal ? "final" : "preview";
    json["component"] = options.component;
    json["depth"] = frame.picture.deepest;
    if (r.mode == Mode::kSurface) json["iso"] = r.iso, json["occlusion_rays"] = r.occlusionRays;
    if (r.mode != Mode::kSurface) {
      json["clim"] = {frame.picture.low, frame.picture.high};
      json["log"] = r.transfer.log;
      json["cmap"] = frame.hasColors ? r.transfer.colors : "";
    }
    if (r.mode == Mode::kFog) {
      json["opacity"] = r.transfer.opacity;
      if (r.transfer.awayFrom) json["opacity_rises_from"] = r.transfer.from;
      json["anisotropy"] = r.anisotropy;
      json["albedo"] = r.albedo;
      json["bounces"] = r.bounces;
      json["opacity_unit"] = frame.picture.opacityUnit;
    }
    json["light"] = vector(frame.picture.light);
  } else {
    json["mode"] = "points";
  }
  OutputFile file(path);
  file.write(json.dump(2, ' ', false, nlohmann::json::error_handler_t::replace) + "\n");
  file.commit();
}

} // namespace Vln
