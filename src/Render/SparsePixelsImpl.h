// Pixels of smooth pictures, most of them from their neighbours.
//
//   R . n . R . n . R     R   a ray from the first on: every second, or fourth, pixel of every such row
//   . . . . . . . . .     n   from the four about it in its row, where these are as good as a cubic; else a
//   ray n . n . n . n . n     n   then the rows between, from the four above and below; then the same at half
//                             the distance
#pragma once

#include "Render/PixelBlocks.h"
#include "Render/Renderer.h"
#include "Render/Threads.h"

#include <algorithm>
#include <atomic>
#include <cmath>

namespace VLN::Render {

class SparsePixels {
public:
  SparsePixels(Picture& picture, PixelBlocks const& blocks, int threads)
      : m_picture(picture)
      , m_blocks(blocks)
      , m_threads(threads) {}

  /// @param stride 1, 2 or 4: pixels from ray to ray at first.
  /// @param trace Draws a pixel, from its x and y. @param watch Told the share that is done.
  /// @return How many pixels were drawn by rays.
  /// @numeric The same for any number of threads.
  template <class Trace, class Watch> std::int64_t draw(int stride, Trace const& trace, Watch const& watch) {
    m_rays = 0;
    m_watch = [&](double share) { watch(share); };
    // What is left to do for each pass is about a third of what was done before.
    pass({0, stride, 0, stride, false, 0}, 0, 0.7, trace);
    double done = 0.7;
    for (int half = stride / 2; half > 0; half /= 2) {
      double const share = half > 1 ? 0.05 : 0.5 * (1 - done);
      pass({0, 2 * half, half, 2 * half, true, half}, done, share, trace);
      pass({half, 2 * half, 0, half, false, half}, done + share, share, trace);
      done += 2 * share;
    }
    return m_rays;
  }

private:
  struct Pass {
    int firstY, stepY, firstX, stepX;
    bool isAlongX;
    int half; ///< distance of the nearest two that are known; 0 where none is
  };
  template <class Trace> void pass(Pass const& p, double done, double share, Trace const& trace) {
    std::int64_t const rows = (m_picture.height - p.firstY + p.stepY - 1) / p.stepY;
    forRanges(
        rows, std::max(1, PixelBlocks::kWidth / p.stepY), m_threads,
        [&](std::int64_t begin, std::int64_t end) {
          std::int64_t rays = 0;
          for (std::int64_t row = begin; row < end; ++row) {
            int const y = p.firstY + static_cast<int>(row) * p.stepY;
            for (int x = p.firstX; x < m_picture.width; x += p.stepX) {
              if (m_blocks.at(x, y).empty() || (p.half > 0 && fill(x, y, p))) continue;
              trace(x, y);
              ++rays;
            }
          }
          m_rays += rays;
        },
        [&](double part) { m_watch(done + share * part); });
  }
  std::size_t at(int x, int y) const {
    return static_cast<std::size_t>(y) * static_cast<std::size_t>(m_picture.width) +
           static_cast<std::size_t>(x);
  }
  /// @return false when its neighbours do not tell what it is.
  bool fill(int x, int y, Pass const& p) {
    int const here = p.isAlongX ? x : y, size = p.isAlongX ? m_picture.width : m_picture.height;
    if (here < 3 * p.half || here + 3 * p.half >= size) return false;
    std::size_t n[4];
    for (int k = 0; k < 4; ++k) {
      int const by = (2 * k - 3) * p.half;
      n[k] = p.isAlongX ? at(x + by, y) : at(x, y + by);
    }
    float opacity;
    auto const itself = [](float v) { return v; };
    if (!(cubic(m_picture.opacity, n, itself, opacity) < kUnseen)) return false;
    bool isEmpty = true;
    for (std::size_t k : n) isEmpty = isEmpty && m_picture.opacity[k] == 0;
    if (isEmpty) return true;
    if (m_picture.opacity[n[1]] == 0 || m_picture.opacity[n[2]] == 0) return false;
    Vec3 color;
    for (int a = 0; a < 3; ++a) {
      auto const part = [a](Vec3 v) { return v[a]; };
      float const bend = cubic(m_picture.color, n, part, color[a]);
      // In the dark less makes a step of a byte: before a background that is not quite black.
      float const light = color[a] + 0.15f * (1 - opacity);
      if (!(bend < kUnseen * std::min(1.0f, 0.1f + 3 * light))) return false;
    }
    std::size_t const to = at(x, y);
    m_picture.opacity[to] = std::clamp(opacity, 0.0f, 1.0f);
    if (m_picture.opacity[to] == 0) return true;
    m_picture.color[to] = color;
    // Depths are multiplied by opacity.
    float depth = 0, weight = 0;
    for (int k = 1; k < 3; ++k) depth += m_picture.depth[n[k]], weight += m_picture.opacity[n[k]];
    m_picture.depth[to] = depth / weight * m_picture.opacity[to];
    return true;
  }
  /// The middle of the cubic through four. @return By how much it differs from the line between the inner
  /// two.
  template <class T, class Part>
  static float cubic(std::vector<T> const& of, std::size_t const n[4], Part const& part, float& v) {
    float const a = part(of[n[0]]), b = part(of[n[1]]), c = part(of[n[2]]), d = part(of[n[3]]);
    float const bend = (b + c - a - d) * (1.0f / 16);
    v = 0.5f * (b + c) + bend;
    return std::abs(bend);
  }

  /// Of light. @source On smoke, cloud and noise: by this the picture differs from that of all rays by at
  /// most a few of 255.
  static constexpr float kUnseen = 1.0f / 768;

  Picture& m_picture;
  PixelBlocks const& m_blocks;
  int m_threads;
  std::atomic<std::int64_t> m_rays{0};
  std::function<void(double)> m_watch;
};

} // namespace VLN::Render
