// TypedGrid: GridSource for one grid type, and the way back from a channel to such a grid.
#pragma once

#include "GeometryVolume/core/Parallel.h"
#include "Interop/VdbGridImpl.h"

#include <algorithm>
#include <cmath>
#include <cstring>
#include <map>

namespace VLN::Interop {

using openvdb::Coord;
using TileTree3D::TreeIndex;
using Velorn::Math::int3;

inline int3 toInt3(Coord const& c) { return {c.x(), c.y(), c.z()}; }
inline Coord toCoord(int3 const& c) { return {c.x, c.y, c.z}; }

// --- Values ---

template <class T> struct ElementOf { using type = T; };
template <> struct ElementOf<bool> { using type = unsigned char; };
template <class S> struct ElementOf<openvdb::math::Vec3<S>> { using type = Velorn::Math::Vec3<S>; };

template <class T> T toElement(T v) { return v; }
inline unsigned char toElement(bool v) { return v ? 1 : 0; }
template <class S> Velorn::Math::Vec3<S> toElement(openvdb::math::Vec3<S> const& v) {
  return {v[0], v[1], v[2]};
}

template <class V, class T> V fromElement(T const& v) {
  if constexpr (std::is_same_v<V, bool>)
    return v != 0;
  else if constexpr (std::is_same_v<V, T>)
    return v;
  else
    return V(v.x, v.y, v.z);
}

/// Equal bit for bit, so that NaN and the sign of zero count.
template <class V> bool sameBits(V const& a, V const& b) { return std::memcmp(&a, &b, sizeof(V)) == 0; }

/// Value, or length of a vector.
template <class T> double magnitude(T const& v) {
  if constexpr (std::is_arithmetic_v<T>)
    return static_cast<double>(v);
  else
    return std::sqrt(double(v[0]) * double(v[0]) + double(v[1]) * double(v[1]) + double(v[2]) * double(v[2]));
}

template <class V> bool followsRule(VdbActiveRule rule, V const& value, V const& background) {
  if (rule == VdbActiveRule::kNotBackground) return !sameBits(value, background);
  if constexpr (std::is_floating_point_v<V>)
    return std::abs(value) < std::abs(background);
  else
    return false;
}

// --- Import ---

/// Calls `f(corner, width, value, active)` for each tile of the file's tree, active or not.
template <class TreeT, class F> void forEachTile(TreeT const& tree, F const& f) {
  using Upper = typename TreeT::RootNodeType::ChildNodeType;
  using Lower = typename Upper::ChildNodeType;
  for (auto it = tree.root().cbeginValueAll(); it; ++it)
    f(it.getCoord(), kNodeWidths[2], *it, it.isValueOn());
  std::vector<Upper const*> uppers;
  tree.getNodes(uppers);
  for (Upper const* node : uppers)
    for (auto it = node->cbeginValueAll(); it; ++it) f(it.getCoord(), kNodeWidths[1], *it, it.isValueOn());
  std::vector<Lower const*> lowers;
  tree.getNodes(lowers);
  for (Lower const* node : lowers)
    for (auto it = node->cbeginValueAll(); it; ++it) f(it.getCoord(), kNodeWidths[0], *it, it.isValueOn());
}

/// Whether every node lies where a search for its position looks: the root's entries come from the file, and
/// so do the corners of leaves of bools and masks.
template <class TreeT> bool placesAgree(TreeT const& tree) {
  using Upper = typename TreeT::RootNodeType::ChildNodeType;
  using Lower = typename Upper::ChildNodeType;
  bool ok = true;
  auto const isEntry = [](Coord const& c) { return (c & -kNodeWidths[2]) == c; };
  for (auto it = tree.root().cbeginChildOn(); it; ++it) ok = ok && isEntry(it.getCoord());
  for (auto it = tree.root().cbeginValueAll(); it; ++it) ok = ok && isEntry(it.getCoord());
  std::vector<Lower const*> parents;
  tree.getNodes(parents);
  for (Lower const* parent : parents)
    for (auto it = parent->cbeginChildOn(); it; ++it) ok = ok && it.getCoord() == it->origin();
  return ok;
}

/// As forEachTile(), active ones alone.
template <class TreeT, class F> void forEachActiveTile(TreeT const& tree, F const& f) {
  using Upper = typename TreeT::RootNodeType::ChildNodeType;
  using Lower = typename Upper::ChildNodeType;
  for (auto it = tree.root().cbeginValueOn(); it; ++it) f(it.getCoord(), kNodeWidths[2], *it);
  std::vector<Upper const*> uppers;
  tree.getNodes(uppers);
  for (Upper const* node : uppers)
    for (auto it = node->cbeginValueOn(); it; ++it) f(it.getCoord(), kNodeWidths[1], *it);
  std::vector<Lower const*> lowers;
  tree.getNodes(lowers);
  for (Lower const* node : lowers)
    for (auto it = node->cbeginValueOn(); it; ++it) f(it.getCoord(), kNodeWidths[0], *it);
}

inline bool fitsTheTree(Coord const& corner, int width) {
  for (int a = 0; a < 3; ++a) {
    // The domain's ends are multiples of every node's width, so a corner inside means that all is.
    if (!VdbTraits::inDomain(corner[a]) || (corner[a] & (width - 1)) != 0) return false;
  }
  return true;
}

inline void growBy(IndexBox& box, Coord const& corner, int width) {
  box.grow(toInt3(corner));
  box.grow(toInt3(corner.offsetBy(width)));
}

inline int3 alignTo(int3 const& c, int depth) {
  return {VdbTraits::align(c.x, depth), VdbTraits::align(c.y, depth), VdbTraits::align(c.z, depth)};
}

GridSummary joinSummaries(GridSummary a, GridSummary const& b);

template <class GridT> class TypedGrid final : public GridSource {
public:
  using TreeT = typename GridT::TreeType;
  using Leaf = typename TreeT::LeafNodeType;
  using Value = typename GridT::ValueType;
  using Element = typename ElementOf<Value>::type;
  using ChannelT = TileTree3D::Channel<VdbTraits, Element, 4, 0>;

  explicit TypedGrid(typename GridT::ConstPtr grid)
      : m_grid(std::move(grid)) {
    m_grid->tree().getNodes(m_leaves);
  }

  openvdb::GridBase const& grid() const override { return *m_grid; }
  std::string type() const override { return m_grid->valueType(); }
  std::size_t bytesPerSample() const override { return sizeof(Element); }

  std::optional<std::string> whyNotPlaced() const override {
    bool ok = placesAgree(m_grid->tree());
    for (Leaf const* leaf : m_leaves) ok = ok && fitsTheTree(leaf->origin(), Leaf::DIM);
    forEachActiveTile(m_grid->tree(),
                      [&](Coord const& c, int width, Value const&) { ok = ok && fitsTheTree(c, width); });
    if (ok) return std::nullopt;
    return "its voxels lie outside " + std::to_string(VdbTraits::kMinTileCoord) + ".." +
           std::to_string(VdbTraits::kMaxTileCoord) + " or off the lattice of its nodes";
  }

  GridSummary summarize() const override {
    GridSummary summary = parallelReduce(
        0, std::int64_t(m_leaves.size()), 256, GridSummary{},
        [&](std::int64_t begin, std::int64_t end) {
          GridSummary s;
          for (std::int64_t n = begin; n < end; ++n) {
            Leaf const& leaf = *m_leaves[static_cast<std::size_t>(n)];
            growBy(s.stored, leaf.origin(), Leaf::DIM);
            s.activeVoxels += std::int64_t(leaf.onVoxelCount());
            for (auto it = leaf.cbeginValueOn(); it; ++it) {
              growRange(s, *it);
              growBy(s.active, it.getCoord(), 1);
            }
          }
          return s;
        },
        joinSummaries);
    forEachActiveTile(m_grid->tree(), [&](Coord const& c, int width, Value const& value) {
      growBy(summary.stored, c, width);
      growBy(summary.active, c, width);
      summary.shallowest = std::min(summary.shallowest, depthOfSamples(width));
      summary.activeVoxels += std::int64_t(width) * width * width;
      ++summary.activeTiles;
      growRange(summary, value);
    });
    Value const background = m_grid->background();
    forEachTile(m_grid->tree(), [&](Coord const& c, int width, Value const& value, bool active) {
      if (active || sameBits(value, background) || !fitsTheTree(c, width)) return;
      growBy(summary.stored, c, width);
      summary.shallowest = std::min(summary.shallowest, depthOfTiles(width));
    });
    return summary;
  }

  void collectStored(std::vector<int3>& leaves, std::vector<int3>& tiles) const override {
    for (Leaf const* leaf : m_leaves) leaves.push_back(toInt3(leaf->origin()));
    Value const background = m_grid->background();
    forEachTile(m_grid->tree(), [&](Coord const& c, int width, Value const& value, bool) {
      if (!sameBits(value, background) && fitsTheTree(c, width)) tiles.push_back(toInt3(c));
    });
  }

  void collectTiles(int rootDepth, std::uint64_t mostTiles, TileCorners& corners) const override {
    auto at = [&](int depth) -> std::vector<int3>& { return corners[static_cast<std::size_t>(depth)]; };
    constexpr int kWidestDepth = depthOfSamples(kNodeWidths[2]);
    Value const background = m_grid->background();
    bool const leavesHaveTile = rootDepth < VdbTraits::kMaxDepth;
    std::vector<int3>& narrow = at(VdbTraits::kMaxDepth);

    collectInParallel(
        std::int64_t(m_leaves.size()), 256, narrow, [&](std::int64_t n, Accessor& grid, auto& part) {
          Leaf const& leaf = *m_leaves[static_cast<std::size_t>(n)];
          for (int slot = 0; slot < 8; ++slot) {
            Coord const c = leaf.origin().offsetBy(4 * (slot & 1), 4 * (slot >> 1 & 1), 4 * (slot >> 2));
            bool const spare = !hasActive(leaf, c) && isUniform(grid, c) &&
                               (leavesHaveTile || sameBits(Value(leaf.getValue(c)), background));
            if (!spare) part.push_back(toInt3(c));
          }
          collectBeforeLeaf(grid, leaf.origin(), part);
        });
    if (leavesHaveTile)
      for (Leaf const* leaf : m_leaves) at(VdbTraits::kMaxDepth - 1).push_back(toInt3(leaf->origin()));

    std::vector<WideTile> tiles;
    forEachTile(m_grid->tree(), [&](Coord const& c, int width, Value const& value, bool active) {
      if (!fitsTheTree(c, width)) return;
      if (active) at(depthOfSamples(width)).push_back(alignTo(toInt3(c), depthOfSamples(width)));
      if (sameBits(value, background)) return;
      // A root over the tile: what has no finer tile is read there.
      at(rootDepth).push_back(alignTo(toInt3(c), rootDepth));
      // And no sample that is wider than any tile of the file: the way back has no place for it.
      if (rootDepth < kWidestDepth) at(kWidestDepth).push_back(alignTo(toInt3(c), kWidestDepth));
      tiles.push_back({c, width, value});
    });
    collectShells(tiles, mostTiles, narrow);
  }

  void collectBeyondRoots(std::set<std::array<int, 3>> const& roots, int depth,
                          std::vector<int3>& out) const override {
    int const width = VdbTraits::width(depth), step = width / VdbTraits::kTDW;
    Value const background = m_grid->background();
    auto grid = m_grid->getConstAccessor();
    for (auto const& root : roots)
      for (int n = 1; n < 8; ++n) {
        int const side[3] = {n & 1, n >> 1 & 1, n >> 2};
        std::array<std::int64_t, 3> beyond;
        bool inside = true;
        for (std::size_t a = 0; a < 3; ++a) {
          beyond[a] = std::int64_t(root[a]) + std::int64_t(side[a]) * width;
          inside = inside && beyond[a] <= VdbTraits::kMaxTileCoord;
        }
        int3 const next{static_cast<int>(beyond[0]), static_cast<int>(beyond[1]),
                        static_cast<int>(beyond[2])};
        if (!inside || roots.count({next.x, next.y, next.z})) continue;
        // Without a root there, the outermost samples would go on for ever.
        bool ends = false;
        for (int s = 0; s < VdbTraits::kTileDataSize && !ends; ++s) {
          int const at[3] = {s % 4, s / 4 % 4, s / 16};
          bool outermost = true;
          for (int a = 0; a < 3; ++a) outermost = outermost && (!side[a] || at[a] == 3);
          ends =
              outermost && !sameBits(Value(grid.getValue(Coord(root[0] + at[0] * step, root[1] + at[1] * step,
                                                               root[2] + at[2] * step))),
                                     background);
        }
        if (ends) out.push_back(next);
      }
  }

  VdbActiveRule activeRule() const override {
    Value const background = m_grid->background();
    bool activeTile = false;
    forEachActiveTile(m_grid->tree(), [&](Coord const&, int, Value const&) { activeTile = true; });
    if (activeTile) return VdbActiveRule::kChannel;
    for (VdbActiveRule const rule : {VdbActiveRule::kNotBackground, VdbActiveRule::kInsideBand}) {
      bool holds = parallelReduce(
          0, std::int64_t(m_leaves.size()), 256, true,
          [&](std::int64_t begin, std::int64_t end) {
            for (std::int64_t n = begin; n < end; ++n)
              for (auto it = m_leaves[static_cast<std::size_t>(n)]->cbeginValueAll(); it; ++it)
                if (it.isValueOn() != followsRule<Value>(rule, *it, background)) return false;
            return true;
          },
          [](bool a, bool b) { return a && b; });
      if (holds)
        forEachTile(m_grid->tree(), [&](Coord const&, int, Value const& value, bool) {
          holds = holds && !followsRule<Value>(rule, value, background);
        });
      if (holds) return rule;
    }
    return VdbActiveRule::kChannel;
  }

  Ostil::Ptr<TileTree3D::ChannelBase> makeChannel(std::string const& name, VdbContainer const& container,
                                                  VdbTopology const& topology,
                                                  FilledTiles filled) const override {
    Element const background = toElement(Value(m_grid->background()));
    auto channel = makeOn<ChannelT>(name, background, topology);
    constexpr std::int64_t kPart = 1 << 16;
    for (int depth = 0; depth <= VdbTraits::kMaxDepth; ++depth)
      for (std::int64_t first = 0; first < container.tileCount(depth); first += kPart) {
        std::int64_t const last = std::min(first + kPart, container.tileCount(depth));
        parallelFor(first, last,
                    [&](std::int64_t begin, std::int64_t end) {
                      auto accessor = m_grid->getConstAccessor();
                      for (std::int64_t n = begin; n < end; ++n)
                        fillTile(accessor, container.tile(n, depth).tijk(), depth,
                                 &*channel->tileData(n, depth).begin());
                    },
                    {.grain = 256});
        filled(last - first);
      }
    return channel;
  }

  Ostil::Ptr<StateChannel> makeStateChannel(std::string const& name, VdbContainer const& container,
                                            VdbTopology const& topology) const override {
    auto channel = makeOn<StateChannel>(name, static_cast<unsigned char>(0), topology);
    for (int depth = 0; depth <= VdbTraits::kMaxDepth; ++depth)
      parallelFor(0, container.tileCount(depth),
                  [&](std::int64_t begin, std::int64_t end) {
                    auto accessor = m_grid->getConstAccessor();
                    for (std::int64_t n = begin; n < end; ++n)
                      fillState(accessor, container.tile(n, depth).tijk(), depth,
                                &*channel->tileData(n, depth).begin());
                  },
                  {.grain = 256});
    return channel;
  }

private:
  using bbox3 = Velorn::Math::bbox<int3, int>;

  static void growRange(GridSummary& s, Value const& value) {
    double const v = magnitude(value);
    if (std::isnan(v)) return;
    s.minimum = s.hasRange ? std::min(s.minimum, v) : v;
    s.maximum = s.hasRange ? std::max(s.maximum, v) : v;
    s.hasRange = true;
  }

  using Accessor = typename GridT::ConstAccessor;

  /// A tile of the file's tree whose value is not the background.
  struct WideTile {
    Coord corner;
    int width;
    Value value;
  };

  /// Appends what `collect(n, accessor, part)` finds for each n, in order.
  template <class Collect>
  void collectInParallel(std::int64_t count, std::int64_t grain, std::vector<int3>& out,
                         Collect const& collect) const {
    std::vector<std::vector<int3>> parts(static_cast<std::size_t>(chunkCount(0, count, grain)));
    parallelChunks(0, count, grain, [&](std::int64_t chunk, std::int64_t begin, std::int64_t end) {
      auto grid = m_grid->getConstAccessor();
      for (std::int64_t n = begin; n < end; ++n) collect(n, grid, parts[static_cast<std::size_t>(chunk)]);
    });
    for (auto const& part : parts) out.insert(out.end(), part.begin(), part.end());
  }

  static bool hasActive(Leaf const& leaf, Coord const& corner) {
    // The mask has a word for each i, a byte of it for each j, a bit of that for each k.
    openvdb::Index const low = Leaf::coordToOffset(corner);
    std::uint64_t const block = std::uint64_t(0x0f0f0f0f) << low % 64;
    for (openvdb::Index i = 0; i < 4; ++i)
      if (leaf.getValueMask().template getWord<std::uint64_t>(low / 64 + i) & block) return true;
    return false;
  }

  /// Whether all voxels of a block of 4 x 4 x 4, and the layer of voxels beyond its high sides, hold one
  /// value: then every blend that begins in the block gives that value.
  static bool isUniform(Accessor& grid, Coord const& corner) {
    Value const first = grid.getValue(corner);
    for (int n = 0; n < 8; ++n) {
      int const step[3] = {n & 1, n >> 1 & 1, n >> 2};
      Coord const c = corner.offsetBy(4 * step[0], 4 * step[1], 4 * step[2]);
      Leaf const* const leaf = grid.probeConstLeaf(c);
      if (!leaf) {
        if (!sameBits(Value(grid.getValue(c)), first)) return false;
        continue;
      }
      openvdb::Index const low = Leaf::coordToOffset(c);
      auto const last = [&](int a) { return openvdb::Index(step[a] ? 1 : 4); };
      for (openvdb::Index i = 0; i < last(0); ++i)
        for (openvdb::Index j = 0; j < last(1); ++j)
          for (openvdb::Index k = 0; k < last(2); ++k)
            if (!sameBits(Value(leaf->getValue(low + 64 * i + 8 * j + k)), first)) return false;
    }
    return true;
  }
  static void collectUnlessUniform(Accessor& grid, Coord const& block, std::vector<int3>& out) {
    if (VdbTraits::inDomain(block.x(), block.y(), block.z()) && !isUniform(grid, block))
      out.push_back(toInt3(block));
  }

  /// The blocks before a leaf's low sides, as far as no leaf holds them.
  static void collectBeforeLeaf(Accessor& grid, Coord const& origin, std::vector<int3>& out) {
    for (int n = 1; n < 8; ++n) {
      int const step[3] = {n & 1, n >> 1 & 1, n >> 2};
      if (grid.probeConstLeaf(origin.offsetBy(-8 * step[0], -8 * step[1], -8 * step[2]))) continue;
      // On an axis with a step the one block before, on the others the leaf's two.
      for (int slot = 0; slot < 8; ++slot) {
        int const at[3] = {slot & 1, slot >> 1 & 1, slot >> 2};
        Coord block = origin;
        bool once = true;
        for (int a = 0; a < 3; ++a) {
          once = once && !(step[a] && at[a]);
          block[a] += step[a] ? -4 : 4 * at[a];
        }
        if (once) collectUnlessUniform(grid, block, out);
      }
    }
  }

  /// Whether something else than the tile's value lies beside it: its 26 neighbours of the same width.
  static bool isExposed(Accessor& grid, WideTile const& tile) {
    int const level = tile.width == kNodeWidths[0] ? 2 : tile.width == kNodeWidths[1] ? 1 : 0;
    for (int n = 0; n < 27; ++n) {
      Coord const c = tile.corner.offsetBy((n % 3 - 1) * tile.width, (n / 3 % 3 - 1) * tile.width,
                                           (n / 9 - 1) * tile.width);
      if (grid.getValueDepth(c) > level || !sameBits(Value(grid.getValue(c)), tile.value)) return true;
    }
    return false;
  }

  /// The blocks at the surfaces of wide tiles: those inside at the high sides, and those before the low ones.
  /// Inside such a block a value goes over to another one within one voxel.
  void collectShells(std::vector<WideTile> tiles, std::uint64_t mostTiles, std::vector<int3>& out) const {
    std::vector<char> exposed(tiles.size());
    parallelFor(0, std::int64_t(tiles.size()),
                [&](std::int64_t begin, std::int64_t end) {
                  auto grid = m_grid->getConstAccessor();
                  for (auto n = static_cast<std::size_t>(begin); n < static_cast<std::size_t>(end); ++n)
                    exposed[n] = isExposed(grid, tiles[n]);
                },
                {.grain = 64});
    std::size_t kept = 0;
    for (std::size_t n = 0; n < tiles.size(); ++n)
      if (exposed[n]) tiles[kept++] = tiles[n];
    tiles.resize(kept);

    std::uint64_t planned = out.size();
    for (int const width : kNodeWidths) {
      // A shell grows with the square of the width: where memory ends, the widest tiles stay coarse.
      int const across = width / 4;
      std::vector<Coord> corners;
      for (auto const& tile : tiles)
        if (tile.width == width) corners.push_back(tile.corner);
      planned += std::uint64_t(corners.size()) * 6 * std::uint64_t(across) * std::uint64_t(across);
      if (planned > mostTiles) return;
      auto const rows = std::int64_t(across) + 1;
      collectInParallel(std::int64_t(corners.size()) * rows, width == kNodeWidths[0] ? 96 : 1, out,
                        [&](std::int64_t n, Accessor& grid, auto& part) {
                          collectRow(grid, corners[static_cast<std::size_t>(n / rows)], across,
                                     static_cast<int>(n % rows) - 1, part);
                        });
    }
  }
  /// The shell's blocks with one z, of -1 to across - 1.
  static void collectRow(Accessor& grid, Coord const& corner, int across, int z, std::vector<int3>& out) {
    auto const outer = [&](int c) { return c == -1 || c == across - 1; };
    for (int y = -1; y < across; ++y) {
      int const step = outer(z) || outer(y) ? 1 : across;
      for (int x = -1; x < across; x += step)
        collectUnlessUniform(grid, corner.offsetBy(4 * x, 4 * y, 4 * z), out);
    }
  }

  template <class C, class T>
  static Ostil::Ptr<C> makeOn(std::string const& name, T const& value, VdbTopology const& topology) {
    auto channel =
        Ostil::makePtr<C>(name, &value, TileTree3D::kInitializeNone, false, true, 0, VdbTraits::kMaxDepth);
    channel->setTargetName(topology.name());
    channel->setOwner(topology.getTargetName());
    channel->update(topology);
    return channel;
  }

  static void fillTile(Accessor& grid, int3 const& corner, int depth, Element* samples) {
    int const step = VdbTraits::width(depth) / VdbTraits::kTDW;
    Coord const origin = toCoord(corner);
    if (step == 1) {
      // The tile lies in one leaf or in one tile of the file's tree.
      Leaf const* leaf = grid.probeConstLeaf(origin);
      if (!leaf) {
        std::fill(samples, samples + VdbTraits::kTileDataSize, toElement(Value(grid.getValue(origin))));
        return;
      }
      openvdb::Index const first = Leaf::coordToOffset(origin);
      auto const copy = [&](auto const& valueAt) {
        for (openvdb::Index k = 0; k < 4; ++k)
          for (openvdb::Index j = 0; j < 4; ++j)
            for (openvdb::Index i = 0; i < 4; ++i)
              *samples++ = toElement(Value(valueAt(first + 64 * i + 8 * j + k)));
      };
      if constexpr (std::is_same_v<Value, bool>) // kept as bits
        copy([&](openvdb::Index n) { return leaf->getValue(n); });
      else
        copy([values = leaf->buffer().data()](openvdb::Index n) { return values[n]; });
      return;
    }
    for (int k = 0; k < 4; ++k)
      for (int j = 0; j < 4; ++j)
        for (int i = 0; i < 4; ++i)
          *samples++ = toElement(Value(grid.getValue(origin.offsetBy(i * step, j * step, k * step))));
  }

  static void fillState(Accessor& grid, int3 const& corner, int depth, unsigned char* states) {
    Coord const origin = toCoord(corner);
    if (depth == VdbTraits::kMaxDepth) {
      Leaf const* leaf = grid.probeConstLeaf(origin);
      if (!leaf) return;
      openvdb::Index const first = Leaf::coordToOffset(origin);
      for (openvdb::Index k = 0; k < 4; ++k)
        for (openvdb::Index j = 0; j < 4; ++j)
          for (openvdb::Index i = 0; i < 4; ++i)
            *states++ = static_cast<unsigned char>(
                kVdbStateLeaf | (leaf->isValueOn(first + 64 * i + 8 * j + k) ? kVdbStateActive : 0));
      return;
    }
    int const step = VdbTraits::width(depth) / VdbTraits::kTDW;
    // Depth of the file's tree whose tiles are as wide as a sample: 2, 1 or 0 for 8, 128 or 4096.
    int const level = step == kNodeWidths[0]   ? 2
                      : step == kNodeWidths[1] ? 1
                      : step == kNodeWidths[2] ? 0
                                               : -2;
    if (level == -2) return;
    for (int k = 0; k < 4; ++k)
      for (int j = 0; j < 4; ++j)
        for (int i = 0; i < 4; ++i, ++states) {
          Coord const c = origin.offsetBy(i * step, j * step, k * step);
          if (grid.getValueDepth(c) == level && grid.isValueOn(c)) *states = kVdbStateActive;
        }
  }

  typename GridT::ConstPtr m_grid;
  std::vector<Leaf const*> m_leaves;
};

// --- Export ---

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
      , m_grid(GridT::create(m_background)) {}

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
      for (int slot = 0; slot < 8; ++slot)
        block.quarters[static_cast<std::size_t>(slot)] = tile.childIndex(slot);
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
      at->second.quarters[static_cast<std::size_t>(slot)] = root->second.index;
    }
    for (auto const& entry : loose) blocks.push_back(entry.second);
    return blocks;
  }

  // Whether the grid has a leaf of its own at a block.
  bool hasLeaf(Block const& block) const {
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
    for (int slot = 0; slot < 8; ++slot) {
      int const qi = 4 * (slot & 1), qj = 4 * (slot >> 1 & 1), qk = 4 * (slot >> 2);
      std::int64_t const quarter = block.quarters[static_cast<std::size_t>(slot)];
      TreeIndex const at{quarter, kMaxDepth};
      // A quarter that was left out has one value, which the tile above holds at its corner.
      Value const uniform = quarter >= 0 || !block.above.valid()
                                ? m_background
                                : valueAt(block.above, {qi / 2, qj / 2, qk / 2});
      for (int k = 0; k < 4; ++k)
        for (int j = 0; j < 4; ++j)
          for (int i = 0; i < 4; ++i) {
            auto const n = Leaf::coordToOffset(Coord(qi + i, qj + j, qk + k));
            Value const value = quarter < 0 ? uniform : valueAt(at, {i, j, k});
            bool active = false;
            if (quarter >= 0)
              active = m_from.state ? (m_from.state->tileData(at)(i, j, k) & kVdbStateActive) != 0
                                    : isActive(value);
            leaf.setValueOnly(n, value);
            leaf.setActiveState(n, active);
          }
    }
  }

  void writeLeaves() {
    std::vector<Block> blocks = leafBlocks();
    std::vector<std::unique_ptr<Leaf>> leaves(blocks.size());
    parallelFor(0, std::int64_t(blocks.size()),
                [&](std::int64_t begin, std::int64_t end) {
                  for (auto n = static_cast<std::size_t>(begin); n < static_cast<std::size_t>(end); ++n) {
                    if (!hasLeaf(blocks[n])) continue;
                    leaves[n] = std::make_unique<Leaf>(blocks[n].origin, m_background, false);
                    fillLeaf(*leaves[n], blocks[n]);
                  }
                },
                {.grain = 64});
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
  typename GridT::Ptr m_grid;
};

/// Source or grid of the one type among `Grids` that fits.
template <class... Grids> std::unique_ptr<GridSource> sourceAmong(openvdb::GridBase::ConstPtr const& grid) {
  std::unique_ptr<GridSource> source;
  auto const attempt = [&]<class GridT>(GridT const*) {
    if (source) return;
    if (auto typed = openvdb::gridConstPtrCast<GridT>(grid))
      source = std::make_unique<TypedGrid<GridT>>(typed);
  };
  (attempt(static_cast<Grids const*>(nullptr)), ...);
  return source;
}
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
