#include "Interop/VdbMake.h"

#include "GeometryVolume/core/Parallel.h"
#include "Interop/FileError.h"
#include "Interop/NoiseImpl.h"
#include "Interop/VdbTypesImpl.h"
#include "Interop/VdbWriteImpl.h"

#include <openvdb/tools/SignedFloodFill.h>

#include <algorithm>
#include <array>
#include <cmath>
#include <memory>

namespace VLN::Interop {

namespace {

using openvdb::Coord;
using Leaf = openvdb::FloatTree::LeafNodeType;

struct Point {
  double x, y, z;
};

// Fills the leaves of a box of blocks of 8 voxels, in parallel, and adds them in order.
// `evaluate(leaf)` returns whether the leaf holds anything.
template <class Evaluate>
void fillLeaves(openvdb::FloatGrid& grid, Coord const& low, Coord const& high, Evaluate const& evaluate,
                Progress const& progress) {
  Coord const first(low.x() >> 3, low.y() >> 3, low.z() >> 3);
  Coord const count = Coord(high.x() >> 3, high.y() >> 3, high.z() >> 3) - first + Coord(1);
  float const background = grid.background();
  for (int i = 0; i < count.x(); ++i) {
    if (progress) progress("making", double(i) / count.x());
    std::vector<std::unique_ptr<Leaf>> slab(static_cast<std::size_t>(count.y()) *
                                            static_cast<std::size_t>(count.z()));
    parallelFor(0, std::int64_t(count.y()) * count.z(),
                [&](std::int64_t begin, std::int64_t end) {
                  for (std::int64_t n = begin; n < end; ++n) {
                    Coord const block = first + Coord(i, int(n / count.z()), int(n % count.z()));
                    auto leaf = std::make_unique<Leaf>(Coord(block.x() * 8, block.y() * 8, block.z() * 8),
                                                       background);
                    if (evaluate(*leaf)) slab[n] = std::move(leaf);
                  }
                },
                {.grain = 16});
    for (auto& leaf : slab)
      if (leaf) grid.tree().addLeaf(leaf.release());
  }
}

void writeGrid(std::string const& path, openvdb::FloatGrid::Ptr const& grid, Progress const& progress) {
  if (progress) progress("writing", 0);
  OutputFile file(path);
  writeVdbFile(file, grid);
  if (progress) progress("writing", 1);
}

// The cloud in its own coordinates: a few overlapping balls, flattened below, with noise on their surface.
class CloudShape {
public:
  CloudShape() {
    for (std::size_t n = 0; n < m_balls.size(); ++n) {
      auto random = [n](int what) {
        return latticeHash(int(n), what, 7, 2024u) / 4294967296.0; // 0 .. 1
      };
      double const far = double(n) / double(m_balls.size());
      m_balls[n] = {{(random(0) * 2 - 1) * 0.75 * (0.3 + far), (random(1) * 2 - 1) * 0.4,
                     random(2) * 0.45 * (1 - 0.6 * far)},
                    0.42 - 0.2 * far};
    }
  }
  static Point low() { return {-1.3, -1.0, -0.7}; }
  static Point high() { return {1.3, 1.0, 1.1}; }

  /// Distance into the smooth shape, negative outside; the noise adds at most kNoise to it.
  double smooth(Point const& p) const {
    double best = -1e9;
    for (Ball const& ball : m_balls) {
      double const x = p.x - ball.center.x, y = p.y - ball.center.y, z = p.z - ball.center.z;
      best = std::max(best, ball.radius - std::sqrt(x * x + y * y + z * z));
    }
    return std::min(best, (p.z + 0.22) * 1.5);
  }
  static double noise(Point const& p) {
    return std::clamp(0.3 * fractalNoise(p.x * 2.7, p.y * 2.7, p.z * 2.7, 6, 11u), -kNoise, kNoise);
  }
  static constexpr double kNoise = 0.36;
  static constexpr double kSteep = 2.5;
  /// At most 1; positive inside. The noise is computed only where it matters.
  double density(Point const& p) const {
    double const depth = smooth(p);
    if (depth <= -kNoise || kSteep * (depth - kNoise) >= 1) return depth > 0 ? 1.0 : 0.0;
    return std::min(1.0, kSteep * (depth + noise(p)));
  }

private:
  struct Ball {
    Point center;
    double radius;
  };
  std::array<Ball, 9> m_balls;
};

openvdb::FloatGrid::Ptr cloudGrid(CloudShape const& shape, double scale, Progress const& progress) {
  auto grid = openvdb::FloatGrid::create(0.0f);
  auto corner = [&](Point const& p) {
    return Coord(int(std::floor(p.x * scale)), int(std::floor(p.y * scale)), int(std::floor(p.z * scale)));
  };
  fillLeaves(
      *grid, corner(CloudShape::low()), corner(CloudShape::high()),
      [&](Leaf& leaf) {
        Coord const o = leaf.origin();
        // The smooth part rises by at most 1.5 for each unit of length, and the block's corners are half
        // its diagonal away.
        Point const middle{(o.x() + 3.5) / scale, (o.y() + 3.5) / scale, (o.z() + 3.5) / scale};
        if (shape.smooth(middle) + CloudShape::kNoise + 1.5 * 6.1 / scale < 0) return false;
        bool any = false;
        for (openvdb::Index n = 0; n < Leaf::SIZE; ++n) {
          Coord const c = leaf.offsetToGlobalCoord(n);
          double const density = shape.density({c.x() / scale, c.y() / scale, c.z() / scale});
          if (density > 0) leaf.setValueOn(n, static_cast<float>(density)), any = true;
        }
        return any;
      },
      progress);
  return grid;
}

void checkCount(std::int64_t voxels) {
  if (voxels < kFewestMadeVoxels || voxels > kMostMadeVoxels)
    throw std::invalid_argument("the number of voxels must lie in " + std::to_string(kFewestMadeVoxels) +
                                ".." + std::to_string(kMostMadeVoxels));
}

} // namespace

void makeCloud(std::string const& path, std::int64_t voxels, Progress const& progress) {
  checkCount(voxels);
  checkOutput(path);
  openvdb::initialize();
  CloudShape const shape;
  // The share of a box that the cloud fills hardly depends on the resolution, so a coarse cloud tells the
  // scale of a fine one.
  double scale = 40;
  for (double size : {20000.0, 150000.0}) {
    auto const count = double(cloudGrid(shape, scale, {})->activeVoxelCount());
    scale *= std::cbrt(std::min(size, double(voxels)) / count);
  }
  auto const count = double(cloudGrid(shape, scale, {})->activeVoxelCount());
  scale *= std::cbrt(double(voxels) / count);
  auto grid = cloudGrid(shape, scale, progress);
  grid->setName("density");
  grid->setGridClass(openvdb::GRID_FOG_VOLUME);
  grid->setTransform(openvdb::math::Transform::createLinearTransform(double(float(5 / scale))));
  writeGrid(path, grid, progress);
}

void makeTorus(std::string const& path, std::int64_t voxels, Progress const& progress) {
  checkCount(voxels);
  checkOutput(path);
  openvdb::initialize();
  constexpr double kHalfWidth = 3, kTube = 0.4;
  constexpr double pi = 3.14159265358979323846;
  // The band between two tubes of radius r - h and r + h round a ring of radius R holds 8 pi^2 R r h.
  double const ring = std::sqrt(double(voxels) / (8 * pi * pi * kTube * kHalfWidth));
  double const tube = kTube * ring;
  double const voxelSize = double(float(1 / ring));
  auto grid = openvdb::FloatGrid::create(static_cast<float>(kHalfWidth * voxelSize));
  float const background = grid->background();
  auto distance = [&](Coord const& c) {
    double const x = c.x(), y = c.y(), z = c.z();
    double const toRing = std::sqrt(x * x + y * y) - ring;
    return std::sqrt(toRing * toRing + z * z) - tube;
  };
  int const wide = int(std::ceil(ring + tube + kHalfWidth)), tall = int(std::ceil(tube + kHalfWidth));
  fillLeaves(
      *grid, Coord(-wide, -wide, -tall), Coord(wide, wide, tall),
      [&](Leaf& leaf) {
        if (std::abs(distance(leaf.origin() + Coord(4))) > kHalfWidth + 7) return false;
        bool any = false;
        for (openvdb::Index n = 0; n < Leaf::SIZE; ++n) {
          double const d = distance(leaf.offsetToGlobalCoord(n));
          if (std::abs(d) < kHalfWidth)
            leaf.setValueOn(n, static_cast<float>(d * voxelSize)), any = true;
          else
            leaf.setValueOff(n, d < 0 ? -background : background);
        }
        return any;
      },
      progress);
  openvdb::tools::signedFloodFill(grid->tree());
  grid->setName("surface");
  grid->setGridClass(openvdb::GRID_LEVEL_SET);
  grid->setTransform(openvdb::math::Transform::createLinearTransform(voxelSize));
  writeGrid(path, grid, progress);
}

} // namespace VLN::Interop
