// Sample a field: store it in tiles of mixed depths, widen it, ask for values and gradients anywhere.
#include "GeometryVolume/channels/Halo.h"
#include "GeometryVolume/channels/NonLeafValues.h"
#include "GeometryVolume/sampling/VoxelSamplerLinear.h"
#include "GeometryVolume/topology/Command.h"

#include <algorithm>
#include <cmath>
#include <iostream>

using namespace VLN::TileTree3D;
using Shape = PowerOfTwoTraits;

int main() {
  // A tree round the origin: coarse tiles over a box, fine ones where the surface of a sphere passes.
  constexpr int kRadius = 40, kDeep = Shape::kMaxDepth;
  Container<Shape> volume("voxel_tile_tree", 0.1f);
  Container<Shape>::TileLists corners;
  for (int depth = kDeep - 3; depth <= kDeep; ++depth) {
    int const w = Shape::width(depth);
    for (int k = -64; k < 64; k += w)
      for (int j = -64; j < 64; j += w)
        for (int i = -64; i < 64; i += w) {
          double const distance = std::hypot(i + w / 2.0, j + w / 2.0, k + w / 2.0) - kRadius;
          if (depth == kDeep - 3 || std::abs(distance) < 4.0 + 1.5 * w)
            corners[static_cast<std::size_t>(depth)].append({i, j, k});
        }
  }
  volume.tileAccessor().addTiles(corners);
  volume.buildAccessorAccelerationStructure(kDeep); // quick entry for positions far apart

  VoxelTopology<Shape> topology("voxel_component", kVoxelOffsetCorner);
  topology.update(volume);
  auto field = Command::createChannel<float, 2, 4, 4, 0, 0>("distance", topology, 0.0f,
                                                            kInitializeDefaultValue, 0, kDeep);
  for (int depth = 0; depth <= kDeep; ++depth)
    for (std::int64_t n = 0; n < volume.tileCount(depth); ++n) {
      auto const& tile = std::as_const(volume).tile(n, depth);
      auto data = field->tileData(tile.treeIndex());
      for (int k = 0; k < 4; ++k)
        for (int j = 0; j < 4; ++j)
          for (int i = 0; i < 4; ++i) {
            auto const p = tile.childDataTIJK(i, j, k);
            data(i, j, k) = 0.1f * (std::hypot(float(p.x), float(p.y), float(p.z)) - kRadius);
          }
    }
  // A coarse sample holds what the finer tile below it has there.
  bool const differs =
      checkIfNonLeafValueIsSetToChildValue(*field, volume, kVoxelOffsetCorner, 1e-5f, 0, kDeep);

  // Read through caches, or widen the tiles once and read in place. Both give the same.
  FloatVoxelSamplerLinear<Shape> const cached(volume, topology, *field);
  auto wide =
      Command::createChannel<float, 2, 4, 5, 0, 0>("wide", topology, 0.0f, kInitializeDefaultValue, 0, kDeep);
  computeHalo<Shape, float, 0, 0, 1, 0>(*field, volume, *wide, -1, -1);
  FloatVoxelSamplerLinear<Shape> const sampler(volume, topology, *wide);

  float worst = 0, slope = 0;
  bool same = true;
  for (int n = 0; n < 1000; ++n) {
    // World positions on the sphere.
    float const a = 0.1f * float(n), z = float(n) / 500 - 1, r = std::sqrt(std::max(0.0f, 1 - z * z));
    float3 const p{4 * r * std::cos(a), 4 * r * std::sin(a), 4 * z};
    float3 gradient;
    float const value = sampler.sampleGradient(p, &gradient);
    same = same && value == cached.sample(p);
    worst = std::max(worst, std::abs(value));
    slope = std::max(slope, std::abs(std::hypot(gradient.x, gradient.y, gradient.z) - 1));
  }
  std::cout << "on the sphere the distance is at most " << worst << ", its gradient 1 within " << slope
            << "\n"
            << "far outside: " << sampler.sample({100.0f, 0.0f, 0.0f}) << "\n";
  return worst < 0.01f && slope < 0.05f && same && !differs ? 0 : 1;
}
