// Volumes to sample, and a sampler whose protected operations are open.
#pragma once

#include "GeometryVolume/channels/Halo.h"
#include "GeometryVolume/sampling/VoxelSamplerLinear.h"

#include <algorithm>
#include <functional>
#include <memory>
#include <random>

namespace VLN::Test {

using namespace TileTree3D;

/// A tree with a core channel that holds a function of tile space at each sample's place, and the same
/// channel widened.
template <class TraitsT> struct SamplerVolume {
  using Core = Channel<TraitsT, float, TraitsT::kTDW, 0>;
  using Wide = Channel<TraitsT, float, TraitsT::kTDW + 1, 0>;
  using Field = std::function<float(double x, double y, double z)>;
  static constexpr int kDeep = TraitsT::kMaxDepth;

  explicit SamplerVolume(VoxelOffsetType type = kVoxelOffsetCorner, float voxelSize = 1.0f)
      : tree("", voxelSize)
      , topology("", type) {}

  /// Adds the tile and its ancestors down from a depth.
  void add(int3 const& p, int depth, int from) {
    auto accessor = tree.tileAccessor();
    for (int d = from; d <= depth; ++d) accessor.addTile(p, d);
  }
  /// A random block of tiles of several depths round a point.
  void addRandom(std::uint32_t seed, int3 const& centre, int tiles, int from) {
    std::mt19937 random(seed);
    for (int n = 0; n < tiles; ++n) {
      int const depth = from + static_cast<int>(random() % static_cast<unsigned>(kDeep - from + 1));
      int const reach = 3 * TraitsT::width(std::max(depth, kDeep - 2));
      auto const c = [&](int middle) {
        return middle + static_cast<int>(random() % static_cast<unsigned>(2 * reach)) - reach;
      };
      add({c(centre.x), c(centre.y), c(centre.z)}, depth, from);
    }
  }
  void fill(Field const& field, float defaultValue = 0.0f, int minDepth = 0, int maxDepth = kDeep) {
    topology.update(tree);
    core =
        std::make_unique<Core>("", &defaultValue, kInitializeDefaultValue, false, true, minDepth, maxDepth);
    wide =
        std::make_unique<Wide>("", &defaultValue, kInitializeDefaultValue, false, true, minDepth, maxDepth);
    core->update(topology), wide->update(topology);
    auto const offset = topology.offset();
    for (int d = minDepth; d <= maxDepth; ++d)
      for (std::int64_t n = 0; n < tree.tileCount(d); ++n) {
        auto const& tile = std::as_const(tree).tile(n, d);
        auto data = core->tileData(n, d);
        double const s = double(TraitsT::width(d)) / TraitsT::kTDW;
        for (int k = 0; k < TraitsT::kTDW; ++k)
          for (int j = 0; j < TraitsT::kTDW; ++j)
            for (int i = 0; i < TraitsT::kTDW; ++i)
              data(i, j, k) =
                  field(tile.ti() + s * (i + double(offset.x)), tile.tj() + s * (j + double(offset.y)),
                        tile.tk() + s * (k + double(offset.z)));
      }
    computeHalo<TraitsT, float, 0, 0, 1, 0>(*core, tree, *wide, -1, -1);
  }

  Container<TraitsT> tree;
  VoxelTopology<TraitsT> topology;
  std::unique_ptr<Core> core;
  std::unique_ptr<Wide> wide;
};

template <class TraitsT> class OpenSampler : public FloatVoxelSamplerLinear<TraitsT> {
public:
  using Base = FloatVoxelSamplerLinear<TraitsT>;
  using Base::accessCount;
  using Base::Base;
  using Base::findTile;
  using Base::updateCache;
};

} // namespace VLN::Test
