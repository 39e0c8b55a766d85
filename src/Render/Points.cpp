#include "Render/Points.h"

#include <algorithm>
#include <chrono>
#include <cmath>
#include <limits>
#include <stdexcept>

namespace VLN::Render {

namespace {

constexpr int kOver = 2; // pixels are drawn that much finer on each axis
constexpr float kNothing = std::numeric_limits<float>::infinity();
constexpr float kShade = 4; // how dark a step in depth is

} // namespace

Picture renderPoints(PointCloud const& cloud, Camera const& camera, int width, int height) {
  if (width < 1 || height < 1 || width > 32768 / kOver || height > 32768 / kOver)
    throw std::invalid_argument("a picture of points has 1 to 16384 pixels an axis");
  auto const began = std::chrono::steady_clock::now();
  int const wide = width * kOver, tall = height * kOver;
  auto const count = static_cast<std::size_t>(wide) * static_cast<std::size_t>(tall);
  std::vector<float> depth(count, kNothing);
  std::vector<std::uint32_t> shown(count);
  for (std::size_t n = 0; n < cloud.positions.size(); ++n) {
    Vec3d const p = camera.project(cloud.positions[n]);
    if (!(p.z > 0)) continue;
    double const r = std::max(0.5 * cloud.radius / (p.z * camera.halfHeight) * tall, 0.71);
    double const x = p.x * wide, y = p.y * tall;
    if (!(x + r >= 0 && y + r >= 0 && x - r <= wide && y - r <= tall)) continue;
    int const x0 = static_cast<int>(std::max(0.0, x - r)), x1 = static_cast<int>(std::min(wide - 1.0, x + r));
    int const y0 = static_cast<int>(std::max(0.0, y - r)), y1 = static_cast<int>(std::min(tall - 1.0, y + r));
    auto const z = static_cast<float>(p.z);
    for (int j = y0; j <= y1; ++j)
      for (int i = x0; i <= x1; ++i) {
        double const dx = i + 0.5 - x, dy = j + 0.5 - y;
        auto const at =
            static_cast<std::size_t>(j) * static_cast<std::size_t>(wide) + static_cast<std::size_t>(i);
        if (dx * dx + dy * dy <= r * r && z < depth[at])
          depth[at] = z, shown[at] = static_cast<std::uint32_t>(n);
      }
  }

  Picture picture;
  picture.width = width, picture.height = height, picture.samples = kOver * kOver;
  auto const pixels = static_cast<std::size_t>(width) * static_cast<std::size_t>(height);
  picture.color.resize(pixels), picture.opacity.resize(pixels), picture.normal.resize(pixels);
  picture.depth.resize(pixels, kNothing);
  constexpr float kShare = 1.0f / (kOver * kOver);
  for (int j = 0; j < tall; ++j)
    for (int i = 0; i < wide; ++i) {
      auto const at =
          static_cast<std::size_t>(j) * static_cast<std::size_t>(wide) + static_cast<std::size_t>(i);
      if (depth[at] == kNothing) continue;
      float behind = 0;
      for (int side = 0; side < 4; ++side) {
        int const x = i + (side == 0 ? -3 : side == 1 ? 3 : 0), y = j + (side == 2 ? -3 : side == 3 ? 3 : 0);
        if (x < 0 || y < 0 || x >= wide || y >= tall) continue;
        float const other =
            depth[static_cast<std::size_t>(y) * static_cast<std::size_t>(wide) + static_cast<std::size_t>(x)];
        if (other < depth[at]) behind += std::log2(depth[at] / other);
      }
      auto const n = static_cast<std::size_t>(j / kOver) * static_cast<std::size_t>(width) +
                     static_cast<std::size_t>(i / kOver);
      float const shade = std::max(0.25f, std::exp(-kShade * behind * 10));
      picture.color[n] = picture.color[n] + cloud.colors[shown[at]] * (shade * kShare);
      picture.opacity[n] += kShare;
      picture.depth[n] = std::min(picture.depth[n], depth[at]);
    }
  picture.seconds = std::chrono::duration<double>(std::chrono::steady_clock::now() - began).count();
  return picture;
}

} // namespace VLN::Render
