// Which pixels of a surface's preview need more than one sample.
#pragma once

#include "Render/PixelBlocks.h"
#include "Render/Renderer.h"
#include "Render/Threads.h"

#include <algorithm>
#include <cmath>

namespace VLN::Render {

/// After the first sample of each pixel, which ones differ from one of those about them: edges, and where
/// light is met by chance. The others get what they have as often as these get samples.
inline std::vector<std::uint8_t> markRestless(Picture const& picture, int threads) {
  constexpr float kAlike = 0.02f; // of light
  std::vector<std::uint8_t> marked(picture.color.size());
  auto const differ = [&](std::size_t a, std::size_t b) {
    Vec3 const d = picture.color[a] - picture.color[b];
    return picture.opacity[a] != picture.opacity[b] ||
           std::max({std::abs(d.x), std::abs(d.y), std::abs(d.z)}) > kAlike;
  };
  auto const width = static_cast<std::int64_t>(picture.width), height = std::int64_t(picture.height);
  forRanges(height, PixelBlocks::kWidth, threads, [&](std::int64_t begin, std::int64_t end) {
    for (std::int64_t y = begin; y < end; ++y)
      for (std::int64_t x = 0; x < width; ++x) {
        auto const n = static_cast<std::size_t>(y * width + x);
        for (std::int64_t j = std::max<std::int64_t>(y - 1, 0); j <= std::min(y + 1, height - 1); ++j)
          for (std::int64_t i = std::max<std::int64_t>(x - 1, 0); i <= std::min(x + 1, width - 1); ++i)
            if (differ(n, static_cast<std::size_t>(j * width + i))) marked[n] = 1;
      }
  });
  return marked;
}

/// @pre No sample of these but the first was added.
inline void repeatUnmarked(Picture& picture, std::vector<std::uint8_t> const& marked) {
  auto const times = static_cast<float>(picture.samples);
  for (std::size_t n = 0; n < marked.size(); ++n) {
    if (marked[n]) continue;
    picture.color[n] = picture.color[n] * times, picture.normal[n] = picture.normal[n] * times;
    picture.opacity[n] *= times, picture.depth[n] *= times;
  }
}

} // namespace VLN::Render
