// GridBuilder: the way back from a channel to a grid of a file.
#pragma once

#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/pools/Jemalloc.h"
#include "Interop/VdbGridMakeImpl.h"
#include "Interop/VdbGridNodesImpl.h"

#include <algorithm>
#include <array>
#include <cstdint>
#include <map>
#include <optional>
#include <tuple>
#include <type_traits>
#include <vector>

namespace VLN::Interop {

/// Builds a grid from the channel that a TypedGrid made.
template <class GridT> class GridBuilder {
  using TreeT = typename GridT::TreeType;
  using Leaf = typename TreeT::LeafNodeType;
  using Value = typename GridT::ValueType;
  using Element = typename ElementOf<Value>::type;
  using ChannelT = TileTree3D::Channel<VdbTraits, Element, 4, 0>;
  static constexpr int kMaxDepth = VdbTraits::kMaxDepth;
  static constexpr int kLeafDepth = kMaxDepth - 1;

public:
  explicit GridBuilder(GridToWrite const& from)
      : m_from(from)
      , m_tree(from.container)
      , m_channel(dynamic_cast<ChannelT const&>(from.channel))
      , m_background(fromElement<Value>(m_channel.defaultValue()))
      , m_alsoActive(from.alsoActive.begin(), from.alsoActive.end())
      , m_grid(GridT::create(m_background)) {
    std::sort(m_alsoActive.begin(), m_alsoActive.end(), PlaceBefore());
    if (from.released) m_released.emplace(dynamic_cast<ChannelT&>(*from.released).tileDataAccessor());
  }

  typename GridT::Ptr build() {
    writeLeaves();
    if (m_from.state)
      for (int const width : kNodeWidths) writeActiveTiles(width);
    writeInactiveTiles();
    return m_grid;
  }

private:
  using TileT = typename VdbContainer::TileType;

  Value valueAt(TreeIndex const& tile, int3 const& sample) const {
    return fromElement<Value>(m_channel.tileData(tile)(sample));
  }
  bool isActive(Value const& value) const { return followsRule<Value>(m_from.rule, value, m_background); }

  // Quarter blocks of the place of a leaf, -1 where there is no tile.
  struct Block {
    Coord origin;
    TreeIndex above; ///< tile as wide as the leaf; invalid when quarters are roots
    std::array<std::int64_t, 8> quarters;
  };

  std::vector<Block> leafBlocks() const {
    std::vector<Block> blocks;
    for (std::int64_t n = 0; n < m_tree.tileCount(kLeafDepth); ++n) {
      TileT const& tile = m_tree.tile(n, kLeafDepth);
      if (tile.isLeaf()) continue;
      Block block{toCoord(tile.tijk()), tile.treeIndex(), {}};
      for (int slot = 0; slot < 8; ++slot) block.quarters[slot] = tile.childIndex(slot);
      blocks.push_back(block);
    }
    // Quarters without a tile above: gathered by the place of their leaf, which lie side by side in Morton
    // order.
    auto tiles = m_tree.tileAccessor();
    std::map<std::array<int, 3>, Block> loose;
    for (auto root = m_tree.cbeginRoots(); root != m_tree.cendRoots(); ++root) {
      if (root->first.depth != kMaxDepth) continue;
      int3 const c = root->first.ijk(), o = alignTo(c, kLeafDepth);
      auto const [at, isNew] = loose.try_emplace({o.x, o.y, o.z});
      if (isNew) at->second = {toCoord(o), {}, {-1, -1, -1, -1, -1, -1, -1, -1}};
      int const slot = (c.x - o.x) / 4 + 2 * ((c.y - o.y) / 4) + 4 * ((c.z - o.z) / 4);
      at->second.quarters[slot] = root->second.index;
    }
    for (auto const& entry : loose) blocks.push_back(entry.second);
    return blocks;
  }

  // By the places of their leaves.
  struct PlaceBefore {
    bool operator()(int3 const& a, int3 const& b) const {
      int3 const p = alignTo(a, kLeafDepth), q = alignTo(b, kLeafDepth);
      return std::tie(p.x, p.y, p.z) < std::tie(q.x, q.y, q.z);
    }
  };
  // Calls `f(from the block's corner)` for the voxels of a block's tiles that are active whatever their
  // values.
  template <class F> void forAlsoActive(Block const& block, F const& f) const {
    if (m_alsoActive.empty()) return;
    int3 const o = toInt3(block.origin);
    auto const [begin, end] = std::equal_range(m_alsoActive.begin(), m_alsoActive.end(), o, PlaceBefore());
    for (auto at = begin; at != end; ++at) {
      int3 const v{at->x - o.x, at->y - o.y, at->z - o.z};
      if (block.quarters[v.x / 4 + 2 * (v.y / 4) + 4 * (v.z / 4)] >= 0) f(v);
    }
  }

  // Whether the grid has a leaf of its own at a block.
  bool hasLeaf(Block const& block) const {
    bool any = false;
    forAlsoActive(block, [&](int3 const&) { any = true; });
    if (any) return true;
    Value const uniform = block.above.valid() ? valueAt(block.above, {0, 0, 0}) : m_background;
    for (std::int64_t const quarter : block.quarters) {
      if (quarter < 0) continue;
      TreeIndex const at{quarter, kMaxDepth};
      if (m_from.state) {
        for (unsigned char const s : m_from.state->tileData(at))
          if (s & kVdbStateLeaf) return true;
      } else {
        for (Element const& v : m_channel.tileData(at)) {
          Value const value = fromElement<Value>(v);
          // Blocks without an active voxel and of one value are inactive tiles, however finely they are cut.
          if (isActive(value) || !sameBits(value, uniform)) return true;
        }
      }
    }
    return false;
  }

  void fillLeaf(Leaf& leaf, Block const& block) const {
    std::array<std::uint64_t, 8> active{};              // a word for each i, k fastest
    constexpr bool kBits = std::is_same_v<Value, bool>; // values that have no addresses
    Value* values = nullptr;
    if constexpr (!kBits) values = leaf.buffer().data();
    auto const write = [&leaf, values](int n, Value const& value) {
      if constexpr (kBits)
        leaf.setValueOnly(static_cast<openvdb::Index>(n), value);
      else
        values[n] = value;
    };
    for (int slot = 0; slot < 8; ++slot) {
      int const qi = 4 * (slot & 1), qj = 4 * (slot >> 1 & 1), qk = 4 * (slot >> 2);
      std::int64_t const quarter = block.quarters[slot];
      TreeIndex const at{quarter, kMaxDepth};
      if (quarter < 0) {
        // A quarter that was left out has one value, which the tile above holds at its corner.
        Value const uniform =
            block.above.valid() ? valueAt(block.above, {qi / 2, qj / 2, qk / 2}) : m_background;
        for (int n = 0; n < 64; ++n)
          write((qi + (n >> 4)) * 64 + (qj + (n >> 2 & 3)) * 8 + qk + (n & 3), uniform);
        continue;
      }
      Element const* const elements = &*m_channel.tileData(at).begin();
      unsigned char const* const states = m_from.state ? &*m_from.state->tileData(at).begin() : nullptr;
      for (int n = 0; n < 64; ++n) {
        int const i = qi + (n & 3), place = (qj + (n >> 2 & 3)) * 8 + qk + (n >> 4);
        Value const value = fromElement<Value>(elements[n]);
        bool const on = states ? (states[n] & kVdbStateActive) != 0 : isActive(value);
        write(i * 64 + place, value);
        active[i] |= std::uint64_t(on) << place;
      }
    }
    forAlsoActive(block, [&](int3 const& v) { active[v.x] |= std::uint64_t(1) << (8 * v.y + v.z); });
    for (openvdb::Index i = 0; i < 8; ++i) leaf.getValueMask().template getWord<std::uint64_t>(i) = active[i];
  }

  // Blocks after which what their tiles held goes back to the system: grids have another allocator.
  static constexpr auto kReleasedAtOnce = (std::int64_t(8) << 20) / std::int64_t(Leaf::SIZE * sizeof(Value));
  // Nothing is read of a block's tiles any more.
  void drop(Block const& block) {
    auto* const tiles = m_released->tileData({0, kMaxDepth}).data();
    for (std::int64_t const quarter : block.quarters)
      if (quarter >= 0) TileVector<Element>().swap(tiles[quarter]);
  }

  void writeLeaves() {
    std::vector<Block> blocks = leafBlocks();
    std::vector<std::unique_ptr<Leaf>> leaves(blocks.size());
    auto const make = [&](std::int64_t begin, std::int64_t end) {
      for (auto n = begin; n < end; ++n) {
        if (hasLeaf(blocks[n])) {
          // Its values come with the first look at them, and all are written.
          leaves[n] = std::make_unique<Leaf>(openvdb::PartialCreate(), blocks[n].origin, m_background, false);
          fillLeaf(*leaves[n], blocks[n]);
        }
        if (m_released) drop(blocks[n]);
      }
    };
    auto const count = std::int64_t(blocks.size()), piece = m_released ? kReleasedAtOnce : count;
    for (std::int64_t first = 0; first < count; first += piece) {
      parallelFor(first, std::min(first + piece, count), make, {.grain = 64});
      if (m_released) jemalloc_purge();
    }
    for (auto& leaf : leaves)
      if (leaf) m_grid->tree().addLeaf(leaf.release());
  }

  static openvdb::Index levelOf(int width) {
    return width == kNodeWidths[0] ? 1 : width == kNodeWidths[1] ? 2 : 3;
  }

  void writeActiveTiles(int width) {
    int const depth = depthOfSamples(width);
    for (std::int64_t n = 0; n < m_tree.tileCount(depth); ++n) {
      TileT const& tile = m_tree.tile(n, depth);
      auto const states = m_from.state->tileData(tile.treeIndex());
      for (int k = 0; k < 4; ++k)
        for (int j = 0; j < 4; ++j)
          for (int i = 0; i < 4; ++i)
            if (states(i, j, k) & kVdbStateActive)
              m_grid->tree().addTile(levelOf(width), toCoord(tile.childDataTIJK(i, j, k)),
                                     valueAt(tile.treeIndex(), {i, j, k}), true);
    }
  }

  // Fills the cube at `corner` with inactive tiles of the file's tree, as wide as fit. What is there already,
  // leaf or active tile, stays.
  void writeInactive(typename GridT::Accessor& grid, int3 const& corner, int width, Value const& value) {
    if (sameBits(value, m_background)) return;
    int const step = width < kNodeWidths[1]   ? kNodeWidths[0]
                     : width < kNodeWidths[2] ? kNodeWidths[1]
                                              : kNodeWidths[2];
    for (int k = 0; k < width; k += step)
      for (int j = 0; j < width; j += step)
        for (int i = 0; i < width; i += step) {
          Coord const c(corner.x + i, corner.y + j, corner.z + k);
          if (grid.probeConstLeaf(c) || grid.isValueOn(c)) continue;
          m_grid->tree().addTile(levelOf(step), c, value, false);
          grid.clear();
        }
  }

  void writeInactiveTiles() {
    auto grid = m_grid->getAccessor();
    // Wide ones first, so that narrow ones are cut out of them. Samples wider than the file's widest tiles
    // stand for no place in it.
    for (int depth = depthOfSamples(kNodeWidths[2]); depth <= kLeafDepth; ++depth) {
      int const sample = VdbTraits::width(depth) / VdbTraits::kTDW;
      for (std::int64_t n = 0; n < m_tree.tileCount(depth); ++n) {
        TileT const& tile = m_tree.tile(n, depth);
        if (depth == kLeafDepth) {
          writeInactive(grid, tile.tijk(), kNodeWidths[0], valueAt(tile.treeIndex(), {0, 0, 0}));
          continue;
        }
        for (int k = 0; k < 4; ++k)
          for (int j = 0; j < 4; ++j)
            for (int i = 0; i < 4; ++i) {
              if (!tile.isLeaf(i / 2, j / 2, k / 2)) continue;
              // Two samples of 4 voxels an axis make one narrowest tile.
              if (sample < kNodeWidths[0] && ((i | j | k) & 1)) continue;
              writeInactive(grid, tile.childDataTIJK(i, j, k), std::max(sample, kNodeWidths[0]),
                            valueAt(tile.treeIndex(), {i, j, k}));
            }
      }
    }
  }

  GridToWrite const& m_from;
  VdbContainer const& m_tree;
  ChannelT const& m_channel;
  Value m_background;
  std::vector<int3> m_alsoActive; ///< by places of leaves
  std::optional<typename ChannelT::TileDataAccessor> m_released;
  typename GridT::Ptr m_grid;
};

/// Grid of the one type among `Grids` that fits.
template <class... Grids> openvdb::GridBase::Ptr gridAmong(std::string const& type, GridToWrite const& from) {
  openvdb::GridBase::Ptr grid;
  auto const attempt = [&]<class GridT>(GridT const*) {
    if (!grid && type == openvdb::typeNameAsString<typename GridT::ValueType>())
      grid = GridBuilder<GridT>(from).build();
  };
  (attempt(static_cast<Grids const*>(nullptr)), ...);
  return grid;
}

} // namespace VLN::Interop
