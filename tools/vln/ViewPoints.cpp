#include "ViewPoints.h"

#include "Render/Colors.h"
#include "ViewCommand.h"

#include <algorithm>
#include <cmath>
#include <stdexcept>

#include <fmt/format.h>

namespace Vln {

using namespace VLN::Render;

namespace {

constexpr std::size_t kFewestPoints = 100;

std::string bytesOf(PointCloud const& cloud, PackedPoints const& box, std::size_t count) {
  std::string places, colors;
  places.reserve(6 * count), colors.reserve(3 * count);
  for (std::size_t n = 0; n < count; ++n) {
    std::size_t const from = n * cloud.positions.size() / count;
    Vec3d const& p = cloud.positions[from];
    for (int a = 0; a < 3; ++a) {
      double const share = box.size[a] > 0 ? (p[a] - box.origin[a]) / box.size[a] : 0;
      auto const code = static_cast<std::uint16_t>(std::lround(65535 * std::clamp(share, 0.0, 1.0)));
      places += static_cast<char>(code & 255), places += static_cast<char>(code >> 8);
    }
    for (int a = 0; a < 3; ++a) colors += static_cast<char>(toSrgbByte(cloud.colors[from][a]));
  }
  return places + colors;
}

} // namespace

PackedPoints packPoints(PointCloud const& cloud, std::uint64_t mostBytes) {
  PackedPoints packed;
  Vec3d low = cloud.positions.front(), high = low;
  for (Vec3d const& p : cloud.positions)
    for (int a = 0; a < 3; ++a) low[a] = std::min(low[a], p[a]), high[a] = std::max(high[a], p[a]);
  packed.origin = low, packed.size = high - low;
  std::size_t const all = cloud.positions.size();
  for (packed.count = all;;) {
    packed.block = packedText(bytesOf(cloud, packed, packed.count));
    if (packed.block.size() <= mostBytes) break;
    // Fewer points are farther apart, and pack a little worse.
    auto const next = static_cast<std::size_t>(0.97 * double(packed.count) * double(mostBytes) /
                                               double(packed.block.size()));
    if (next < std::min(all, kFewestPoints))
      throw std::invalid_argument(fmt::format("its points do not fit into {} bytes", mostBytes));
    packed.count = next;
  }
  packed.radius = cloud.radius * std::sqrt(double(all) / double(packed.count));
  return packed;
}

} // namespace Vln
