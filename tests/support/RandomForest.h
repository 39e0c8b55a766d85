// Random mixed-depth forests: the same sequence of additions given to a container and to the model.
#pragma once

#include "support/ContainerAccess.h"
#include "support/ForestModel.h"

#include <random>

namespace Support {

template <class TraitsT> class RandomForest {
public:
  using ContainerT = VLN::TileTree3D::Container<TraitsT>;
  using Model = ForestModel<TraitsT>;

  explicit RandomForest(std::uint32_t seed)
      : m_random(seed)
      , m_accessor(m_tree.tileAccessor()) {
    // Most forests keep their roots away from depth 0, or a single tree would soon hold everything.
    m_minDepth = pick(0, 3) == 0 ? 0 : pick(1, TraitsT::kMaxDepth);
    for (int n = 0; n < 3; ++n) m_centres.push_back(anyPoint());
    m_centres.push_back({0, 0, 0});
  }

  ContainerT& tree() { return m_tree; }
  Model const& model() const { return m_model; }
  /// No tile lies above this depth.
  int minDepth() const { return m_minDepth; }
  int pick(int low, int high) { return std::uniform_int_distribution<int>(low, high)(m_random); }

  int3 anyPoint() {
    auto const coordinate = [&] { return pick(TraitsT::kMinTileCoord, TraitsT::kMaxTileCoord); };
    return {coordinate(), coordinate(), coordinate()};
  }
  /// Clustered, so that tiles meet; also uniform points, and the corners of the domain.
  int3 point() {
    int const kind = pick(0, 9);
    if (kind == 0) return anyPoint();
    if (kind == 1) {
      auto const end = [&] { return pick(0, 1) ? TraitsT::kMinTileCoord : TraitsT::kMaxTileCoord; };
      return {end(), end(), end()};
    }
    return near(m_centres[static_cast<std::size_t>(pick(0, static_cast<int>(m_centres.size()) - 1))],
                pick(m_minDepth, TraitsT::kMaxDepth));
  }
  /// A point within two tile widths of another.
  int3 near(int3 const& p, int depth) {
    std::int64_t const w = Model::width(depth);
    int3 q = p;
    for (int a = 0; a < 3; ++a) {
      std::int64_t const c = p[a] + std::uniform_int_distribution<std::int64_t>(-2 * w, 2 * w)(m_random);
      q[a] = static_cast<int>(std::clamp<std::int64_t>(c, TraitsT::kMinTileCoord, TraitsT::kMaxTileCoord));
    }
    return q;
  }
  int depth() { return pick(m_minDepth, TraitsT::kMaxDepth); }

  /// One random addition.
  void grow() {
    int3 const p = point();
    int const d = depth();
    switch (pick(0, 6)) {
    case 0:
      Access::addTile(m_tree, p, d);
      m_model.add(p, d);
      break;
    case 1:
    case 2:
      m_accessor.addTile(p, d);
      m_model.add(p, d);
      break;
    case 3: {
      auto fresh = m_tree.tileAccessor();
      fresh.addTile(VoxelCoord{p.x, p.y, p.z, d});
      m_model.add(p, d);
      break;
    }
    case 4: {
      int3 const q = near(p, TraitsT::kMaxDepth - pick(0, 2));
      if (shares(p, q)) {
        m_accessor.addTile(p, q);
        m_model.addAround(p, q);
      }
      break;
    }
    case 5: {
      int3 const q = near(p, d);
      int3 const min{std::min(p.x, q.x), std::min(p.y, q.y), std::min(p.z, q.z)};
      int3 const max{std::max(p.x, q.x), std::max(p.y, q.y), std::max(p.z, q.z)};
      m_accessor.addTiles(min, max, d);
      m_model.addBox(min, max, d);
      break;
    }
    default: // outside
      m_accessor.addTile(TraitsT::kMaxTileCoord, pick(TraitsT::kMaxTileCoord, 2147483646) + 1, 0, d);
      m_accessor.addTile(p, pick(0, 1) ? -1 : TraitsT::kMaxDepth + 1);
      break;
    }
  }

private:
  /// Whether the smallest tile around both points is not above this forest's depths.
  bool shares(int3 const& p, int3 const& q) const {
    return Model::place(p, m_minDepth) == Model::place(q, m_minDepth);
  }

  std::mt19937 m_random;
  ContainerT m_tree;
  Model m_model;
  typename ContainerT::TileAccessor m_accessor;
  int m_minDepth;
  std::vector<int3> m_centres;
};

} // namespace Support
