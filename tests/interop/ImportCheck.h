// The independent side of the import tests: what OpenVDB reads, against what a reader of the tree finds.
#pragma once

#include "GeometryVolume/channels/Channel.h"
#include "GeometryVolume/tiletree/Container.h"
#include "Interop/VdbImportImpl.h"

#include <gtest/gtest.h>

#include <cstring>

namespace VLN::Test {

using Shape = TileTree3D::Traits<2, 4, 0, 1>;
using Tree = TileTree3D::Container<Shape>;
using FloatChannel = TileTree3D::Channel<Shape, float, 4, 0>;

/// Reads a channel as any user would: the deepest tile at a position, else the default value.
class TreeReader {
public:
  TreeReader(Interop::VdbVolume const& volume, std::string const& channel)
      : m_tree(volume.object->component<Tree>("voxel_tile_tree"))
      , m_channel(volume.object->component<FloatChannel>(channel)) {
    if (!m_tree || !m_channel) throw std::runtime_error("no channel " + channel);
    m_accessor = static_cast<Tree const&>(*m_tree).tileAccessor();
  }
  float operator()(openvdb::Coord const& c) const {
    auto const& tile = m_accessor.tile(c.x(), c.y(), c.z(), Tree::kMaxDepth, false);
    FloatChannel const& channel = *m_channel;
    if (!tile.valid()) return channel.defaultValue();
    return channel.tileData(tile.treeIndex())(tile.childDataIJK(c.x(), c.y(), c.z()));
  }
  int depthAt(openvdb::Coord const& c) const {
    return m_accessor.tile(c.x(), c.y(), c.z(), Tree::kMaxDepth, false).depth();
  }
  Tree const& tree() const { return *m_tree; }
  FloatChannel const& channel() const { return *m_channel; }

private:
  Ostil::Ptr<Tree> m_tree;
  Ostil::Ptr<FloatChannel> m_channel;
  Tree::ConstTileAccessor m_accessor;
};

inline bool sameBits(float a, float b) { return std::memcmp(&a, &b, sizeof a) == 0; }

struct Comparison {
  std::int64_t active = 0; ///< voxels of leaves and active tiles that were read and are active
  std::int64_t wrong = 0;
  std::string first; ///< the first wrong one
};

/// Reads every voxel of every leaf, and of every active tile at least its corners and, when it is at most 32
/// wide, all of it.
inline Comparison compareAll(openvdb::FloatGrid const& grid, TreeReader const& reader) {
  Comparison result;
  auto check = [&](openvdb::Coord const& c, float expected) {
    float const got = reader(c);
    if (sameBits(got, expected)) return;
    if (result.wrong++ == 0) {
      std::ostringstream text;
      text << c << " is " << got << " instead of " << expected << ", depth " << reader.depthAt(c);
      result.first = text.str();
    }
  };
  for (auto leaf = grid.tree().cbeginLeaf(); leaf; ++leaf)
    for (auto it = leaf->cbeginValueAll(); it; ++it) {
      check(it.getCoord(), *it);
      result.active += it.isValueOn();
    }
  auto tiles = grid.tree().cbeginValueOn();
  tiles.setMaxDepth(openvdb::FloatTree::ValueOnCIter::LEAF_DEPTH - 1);
  for (; tiles; ++tiles) {
    openvdb::CoordBBox box;
    tiles.getBoundingBox(box);
    result.active += std::int64_t(box.volume());
    int const step = box.dim().x() <= 32 ? 1 : box.dim().x() / 16 - 1;
    for (int i = box.min().x(); i <= box.max().x(); i += step)
      for (int j = box.min().y(); j <= box.max().y(); j += step)
        for (int k = box.min().z(); k <= box.max().z(); k += step) check(openvdb::Coord(i, j, k), *tiles);
    check(box.max(), *tiles);
  }
  return result;
}

/// Every sample of every tile holds the grid's value at its corner.
inline std::int64_t wrongSamples(openvdb::FloatGrid const& grid, TreeReader const& reader) {
  std::int64_t wrong = 0;
  auto const values = grid.getConstAccessor();
  for (int d = 0; d <= Tree::kMaxDepth; ++d)
    for (std::int64_t n = 0; n < reader.tree().tileCount(d); ++n) {
      auto const& tile = reader.tree().tile(n, d);
      for (int k = 0; k < 4; ++k)
        for (int j = 0; j < 4; ++j)
          for (int i = 0; i < 4; ++i) {
            auto const c = tile.childDataTIJK(i, j, k);
            wrong += !sameBits(reader.channel().tileData(tile.treeIndex())({i, j, k}),
                               values.getValue(openvdb::Coord(c.x, c.y, c.z)));
          }
    }
  return wrong;
}

/// The shape that all imported trees share.
inline void expectSoundTree(Tree const& tree) {
  EXPECT_TRUE(tree.checkConsistency(false));
  int roots = -1;
  for (int d = 0; d <= Tree::kMaxDepth; ++d) {
    if (tree.rootCount(d) == 0) continue;
    EXPECT_EQ(roots, -1) << "roots at depths " << roots << " and " << d;
    EXPECT_EQ(tree.rootCount(d), tree.tileCount(d)) << "depth " << d;
    roots = d;
  }
  if (roots < 0) return;
  Velorn::Math::bbox<Velorn::Math::int3, int> box;
  tree.tileSpaceBounds(box);
  for (int a = 0; a < 3; ++a)
    EXPECT_LE((std::int64_t(box.max[a]) - box.min[a]) / Shape::width(roots), 64) << "axis " << a;
}

inline openvdb::FloatGrid::ConstPtr floatGrid(Interop::VdbFile const& file, std::size_t n) {
  return openvdb::gridConstPtrCast<openvdb::FloatGrid>(file.grids.at(n));
}

} // namespace VLN::Test
