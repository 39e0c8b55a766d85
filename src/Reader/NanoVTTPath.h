// TilePath: searches near each other, and TileIterator: tiles in the order of their numbers.
//
//   root ─ tile ─ tile ─ tile     a step to another place climbs to the first tile that holds both, which the
//                  └ x    └ y     highest bit tells in which their coordinates differ, and descends from
//                  there
#pragma once

#include "Reader/NanoVTTCells.h"
#include "Reader/NanoVTTReader.h"

namespace nanovtt {

/// The way from a root to the tile found last.
/// @threads One for each thread.
class TilePath {
public:
  TilePath() = default;
  /// @param maxDepth Deeper tiles are not looked for.
  NANOVTT_HD explicit TilePath(ContainerReader const& tree, int maxDepth = kMaxDepth)
      : m_tree(tree)
      , m_llc(tree.lowestCorner())
      , m_wraps(wraps(m_llc.x, tree.rootDepth()) || wraps(m_llc.y, tree.rootDepth()) ||
                wraps(m_llc.z, tree.rootDepth()))
      , m_lowestShift(maxDepth < kMaxDepth ? kTileSpaceBits - maxDepth : kLeastShift) {}
  /// @param cells Where searches begin; those of a table deeper than `maxDepth` do not.
  NANOVTT_HD TilePath(ContainerReader const& tree, CellTable const& cells, int maxDepth = kMaxDepth)
      : TilePath(tree, maxDepth) {
    if (cells.depth() < 0 || cells.depth() > maxDepth) return;
    m_cells = cells;
    m_firstOfCells = tree.tilesAbove(cells.depth());
    m_enterAbove = kTileSpaceBits - cells.depth();
  }

  NANOVTT_HD ContainerReader const& container() const { return m_tree; }
  NANOVTT_HD int maxDepth() const { return kTileSpaceBits - m_lowestShift; }

  /// To the deepest tile at or above `maxDepth` that holds the point, as ContainerReader::find() finds it.
  /// @return false when there is none.
  NANOVTT_HD bool moveTo(std::int32_t x, std::int32_t y, std::int32_t z) {
    std::uint32_t const ux = from(x, m_llc.x), uy = from(y, m_llc.y), uz = from(z, m_llc.z);
    std::uint32_t const differ = (ux ^ m_x) | (uy ^ m_y) | (uz ^ m_z);
    m_x = ux, m_y = uy, m_z = uz;
    // What the steps change is kept out of the members until they are done: so it stays in registers.
    Level* level = m_levels + m_height;
    while (level != m_levels && differ >> level->shift) --level;
    m_height = 0;
    if (m_wraps && (x < m_llc.x || y < m_llc.y || z < m_llc.z)) return false;
    if (level->shift > m_enterAbove) {
      Level const entry = enter(ux, uy, uz, *level);
      if (entry.tile == kNoTile) return false;
      if (level == m_levels || entry.shift < level->shift) m_levels[1] = entry, level = m_levels + 1;
    }
    while (level->shift > m_lowestShift) {
      int const levels = level->levels, down = level->shift - levels - 1;
      if (down < m_lowestShift) break;
      std::uint32_t const i = ux >> down, j = uy >> down, k = uz >> down;
      std::uint32_t const slot =
          levels == 0 ? (i & 1) | (j & 1) << 1 | (k & 1) << 2 : wideSlot(levels, i, j, k);
      auto const child = load<std::uint32_t>(level->table + 4 * std::uint64_t(slot));
      if (child == kNoTile) break;
      *++level = at(child, down);
    }
    m_height = static_cast<int>(level - m_levels);
    return true;
  }

  /// The tile. @pre moveTo() found one.
  NANOVTT_HD TileRef tile() const {
    return {number(), depth(), {corner(m_llc.x, m_x), corner(m_llc.y, m_y), corner(m_llc.z, m_z)}};
  }
  NANOVTT_HD std::uint32_t number() const { return top().tile; }
  NANOVTT_HD int depth() const { return kTileSpaceBits - top().shift; }
  /// log2 of the width of the cube about the point in which no deeper tile lies than this one.
  /// @pre moveTo() found a tile.
  NANOVTT_HD int alikeShift() const {
    Level const& l = top();
    if (l.shift <= m_lowestShift || !m_tree.hasChildren(l.tile)) return l.shift;
    int const below = l.shift - l.levels - 1;
    return below < m_lowestShift ? l.shift : below;
  }

private:
  struct Level {
    unsigned char const* table; ///< of the children; of the deepest depth none
    std::uint32_t tile;
    std::int16_t shift;  ///< log2 of the tile's width
    std::int16_t levels; ///< that a step into the table passes over
  };
  static constexpr int kLeastShift = kTileSpaceBits - kMaxDepth;

  NANOVTT_HD Level const& top() const { return m_levels[m_height]; }
  NANOVTT_HD Level at(std::uint32_t tile, int shift) const {
    if (shift == kLeastShift) return {nullptr, tile, kLeastShift, 0};
    ContainerReader::Children const list = m_tree.children(tile);
    return {list.table, tile, static_cast<std::int16_t>(shift), static_cast<std::int16_t>(list.levels)};
  }
  // A point's first tile, from a cell or the root table.
  // @param known What is known already.
  NANOVTT_HD Level enter(std::uint32_t ux, std::uint32_t uy, std::uint32_t uz, Level const& known) const {
    std::uint32_t tile = kNoTile;
    int depth = m_tree.rootDepth();
    if (m_cells.find(ux, uy, uz, tile)) {
      // Most cells have a tile as wide.
      if (tile != kNoTile) depth = tile >= m_firstOfCells ? m_cells.depth() : m_tree.depthOf(tile);
    } else {
      if (known.tile != kNoTile) return known;
      int const s = kTileSpaceBits - depth;
      std::uint32_t const i = ux >> s, j = uy >> s, k = uz >> s;
      if ((i | j | k) < kRootTableWidth && s >= m_lowestShift)
        tile = m_tree.root((k * kRootTableWidth + j) * kRootTableWidth + i);
    }
    return tile == kNoTile ? nowhere() : at(tile, kTileSpaceBits - depth);
  }
  NANOVTT_HD static std::uint32_t wideSlot(int levels, std::uint32_t i, std::uint32_t j, std::uint32_t k) {
    int const bits = levels + 1;
    std::uint32_t const mask = (1u << bits) - 1;
    return (i & mask) | (j & mask) << bits | (k & mask) << 2 * bits;
  }
  NANOVTT_HD static std::uint32_t from(std::int32_t c, std::int32_t lowest) {
    return static_cast<std::uint32_t>(c) - static_cast<std::uint32_t>(lowest);
  }
  // Below the lowest corner there is no root, but the difference may look like that of one: not where the
  // roots are small beside the integers, and the corner lies in tile space.
  NANOVTT_HD static bool wraps(std::int32_t lowest, int rootDepth) {
    constexpr std::int32_t kEnd = std::int32_t(1) << (kTileSpaceBits - 1);
    return rootDepth < 6 || lowest < -kEnd || lowest > kEnd;
  }
  NANOVTT_HD std::int32_t corner(std::int32_t lowest, std::uint32_t d) const {
    int const s = top().shift;
    return static_cast<std::int32_t>(static_cast<std::uint32_t>(lowest) + (d >> s << s));
  }

  NANOVTT_HD static constexpr Level nowhere() { return {nullptr, kNoTile, 32, 0}; }

  ContainerReader m_tree;
  Coord m_llc;
  bool m_wraps = false; ///< whether places below m_llc must be told apart
  CellTable m_cells;
  std::uint32_t m_firstOfCells = 0; ///< of the tiles as wide as a cell
  int m_lowestShift = kLeastShift;  ///< that of the deepest tiles which are looked for
  int m_enterAbove = 31;            ///< from wider tiles on, a cell is the shorter way
  int m_height = 0;                 ///< levels that hold the point; 0: none
  std::uint32_t m_x = 0, m_y = 0, m_z = 0;
  Level m_levels[kMaxDepth + 2] = {nowhere()}; ///< the first one is none
};

/// Tiles by their numbers, which are those of one depth after the other: where each lies, without the
/// traversal structure. It keeps the tiles above the last one, so that a step to a tile beside it costs no
/// search from the root.
/// @cost Of a step: a look at the parent's table; up the tree only where the parent is another one. A root's
/// slot is looked for from that of the root before.
/// @threads One for each thread.
class TileIterator {
public:
  TileIterator() = default;
  NANOVTT_HD explicit TileIterator(ContainerReader const& tree, std::uint32_t number = 0)
      : m_tree(tree)
      , m_depth(tree.rootDepth()) {
    seek(number);
  }

  /// To any tile. @edges From the number of tiles on the iterator is at the end.
  NANOVTT_HD void seek(std::uint32_t number) {
    m_number = number;
    if (number >= m_tree.tileCount()) return;
    while (number < m_tree.tilesAbove(m_depth)) --m_depth;
    while (number >= m_tree.tilesAbove(m_depth + 1)) ++m_depth;
    place();
  }
  /// @pre Not at the end.
  NANOVTT_HD TileRef operator*() const { return {m_number, m_depth, m_levels[m_depth].corner}; }
  NANOVTT_HD std::uint32_t number() const { return m_number; }
  NANOVTT_HD bool atEnd() const { return m_number >= m_tree.tileCount(); }
  NANOVTT_HD TileIterator& operator++() {
    seek(m_number + 1);
    return *this;
  }
  /// @pre Not at tile 0.
  NANOVTT_HD TileIterator& operator--() {
    seek(m_number - 1);
    return *this;
  }
  NANOVTT_HD friend bool operator==(TileIterator const& a, TileIterator const& b) {
    return a.m_number == b.m_number;
  }
  NANOVTT_HD friend bool operator!=(TileIterator const& a, TileIterator const& b) { return !(a == b); }

private:
  struct Level {
    std::uint32_t tile = kNoTile;
    std::uint32_t parent = kNoTile;
    std::uint32_t slot = 0; ///< in the root table, or the parent's
    Coord corner;
  };

  // Fills the levels from the first tile above that is known already.
  NANOVTT_HD void place() {
    int depths[kMaxDepth + 1], count = 0;
    std::uint32_t tile = m_number;
    for (int depth = m_depth; m_levels[depth].tile != tile; depth = depthAbove(tile, depth)) {
      Level& l = m_levels[depth];
      std::uint32_t const parent = m_tree.parent(tile);
      if (l.tile == kNoTile || l.parent != parent) l.slot = parent == kNoTile ? m_rootSlot : 0;
      l.tile = tile, l.parent = parent;
      depths[count++] = depth;
      if (parent == kNoTile) break;
      tile = parent;
    }
    while (count-- > 0) find(m_levels[depths[count]], depths[count]);
  }
  NANOVTT_HD int depthAbove(std::uint32_t tile, int depth) const {
    while (tile < m_tree.tilesAbove(depth)) --depth;
    return depth;
  }
  NANOVTT_HD void find(Level& l, int depth) {
    if (l.parent == kNoTile) {
      l.slot = nearest(m_rootSlot, kMaxRoots, [&](std::uint32_t n) { return m_tree.root(n) == l.tile; });
      m_rootSlot = l.slot;
      l.corner = m_tree.rootCorner(l.slot);
      return;
    }
    ContainerReader::Children const list = m_tree.children(l.parent);
    l.slot = nearest(l.slot, list.count(), [&](std::uint32_t n) { return list[n] == l.tile; });
    Coord const top = m_levels[depth - list.levels - 1].corner;
    int const shift = kTileSpaceBits - depth;
    std::uint32_t const across = list.across();
    l.corner = {at(top.x, l.slot % across, shift), at(top.y, l.slot / across % across, shift),
                at(top.z, l.slot / across / across, shift)};
  }
  // The slot of a table that answers, on one side or the other of the one before. There is one.
  template <class Is>
  NANOVTT_HD static std::uint32_t nearest(std::uint32_t from, std::uint32_t count, Is const& is) {
    for (std::uint32_t n = 0; n < count; ++n) {
      if (is((from + n) % count)) return (from + n) % count;
      if (is((from - n) % count)) return (from - n) % count; // counts are powers of two
    }
    return from;
  }
  NANOVTT_HD static std::int32_t at(std::int32_t corner, std::uint32_t n, int shift) {
    return static_cast<std::int32_t>(static_cast<std::uint32_t>(corner) + (n << shift));
  }

  ContainerReader m_tree;
  std::uint32_t m_number = 0;
  int m_depth = 0;
  std::uint32_t m_rootSlot = 0;
  Level m_levels[kMaxDepth + 1];
};

/// for (TileRef tile : tilesOf(container)) ...
struct TileRange {
  ContainerReader tree;
  NANOVTT_HD TileIterator begin() const { return TileIterator(tree); }
  NANOVTT_HD TileIterator end() const { return TileIterator(tree, tree.tileCount()); }
};
NANOVTT_HD inline TileRange tilesOf(ContainerReader const& tree) { return {tree}; }

} // namespace nanovtt
