// ContainerLayout: the container section of a flat buffer. Planned first, so that every size is known before
// anything is written; then written in place. All grids share it.
//
//   plan      root depth -> numbers of the tiles -> merged blocks -> child tables -> who has a halo
//   write     root table, child offsets, parents, child tables, sentinel
//
// The planned tables stay for the grids, which ask for the number and the place of each tile.
#pragma once

#include "GeometryVolume/core/Object.h"
#include "GeometryVolume/nanovtt/ConversionSettingsImpl.h"
#include "Reader/NanoVTTFormat.h"

#include <array>
#include <atomic>
#include <vector>

namespace nanovtt::Internal {

/// What coalescing found out about the tiles of one depth.
struct CoalescedTiles {
  std::vector<std::uint8_t> full;    ///< complete levels below the tile, at most kMaxCoalescedLevels
  std::vector<std::uint8_t> height;  ///< of the tree below the tile
  std::vector<std::uint8_t> inBlock; ///< 1 when the block of an ancestor holds the tile

  void resize(std::size_t n) { full.resize(n), height.resize(n), inBlock.resize(n); }
};

class ContainerLayout {
public:
  ContainerLayout(Tree const& tree, ConversionSettings const& settings)
      : m_tree(tree)
      , m_settings(settings)
      , m_log(settings.log)
      , m_maxDepth(settings.maxDepth()) {}

  /// Settles everything but the contents.
  /// @return false when a root lies deeper than the root depth, which standard error then tells.
  /// @error std::runtime_error for more tiles than numbers.
  bool plan(VLN::Object const& object, BufferMaker const& makeBuffer);
  /// Clears what write() leaves out.
  void clear(std::uint8_t* bytes) const;
  /// Writes the section.
  /// @pre The bytes are cleared, size() of them.
  void write(std::uint8_t* bytes, std::uint64_t bufferSize) const;

  Tree const& tree() const { return m_tree; }
  int rootDepth() const { return m_rootDepth; }
  int maxDepth() const { return m_maxDepth; }
  /// Bytes of the section.
  std::uint64_t size() const { return m_size; }
  std::uint32_t tileCount() const { return m_tileCountAccum[kTileCountAccumEntries - 1]; }
  std::uint64_t haloTileCount() const { return m_haloTiles; }
  /// Whether some numbers belong to dead tiles, which nobody writes.
  bool hasDeadTiles() const { return m_deadTiles > 0; }

  /// The number of a tile that is not inside a block.
  std::uint32_t number(int depth, std::int64_t index) const {
    auto const& order = m_order[depth];
    return m_tileCountAccum[depth] + (order.empty() ? static_cast<std::uint32_t>(index) : order[index]);
  }
  bool hasHalo(std::uint32_t number) const {
    return m_halo == Halo::kSome ? m_halosBefore[number + 1] != m_halosBefore[number] : m_halo == Halo::kAll;
  }
  /// Halo tiles with smaller numbers.
  std::uint64_t halosBefore(std::uint32_t number) const {
    return m_halo == Halo::kSome ? m_halosBefore[number] : m_halo == Halo::kAll ? number : 0;
  }

  // Coalescing
  bool coalesced() const { return m_settings.coalesce; }
  bool inBlock(int depth, std::int64_t index) const {
    return coalesced() && m_coalesced[depth].inBlock[index];
  }
  /// Levels of the block that the tile heads; 0 for a tile that heads none.
  int blockLevels(TileType const& tile) const;
  /// The head of the block that holds the tile.
  /// @pre inBlock().
  TileType const& blockHead(TileType const& tile) const;
  /// Samples of all tiles and blocks with smaller numbers; of all for tileCount().
  std::uint64_t samplesBefore(std::uint32_t number) const { return m_samplesBefore[number]; }

private:
  enum class Halo : std::uint8_t { kNone, kAll, kSome };

  std::uint32_t depthCount(int depth) const { return m_tileCountAccum[depth + 1] - m_tileCountAccum[depth]; }
  int fullLevels(TreeIndex const& at) const { return m_coalesced[at.depth].full[at.index]; }
  int height(TileType const& tile) const { return m_coalesced[tile.depth()].height[tile.index()]; }
  /// Whether the tile's children are found by number: it has some, of a depth that is converted, and they are
  /// not all inside its own block.
  bool hasChildTable(TileType const& tile) const;

  int rootEntries(int depth, int& size, int3& lowest) const;
  void chooseRootDepth();
  void raiseToCoarseContent(VLN::Object const& object);
  void reportRoots() const;
  bool rootsFit() const;
  void numberTiles();
  void countTiles();
  void planChildTables();

  void findBlocks();
  void numberBlocks();

  void planHalos();
  bool wantsHalo(TileType const& tile, Tree::ConstTileAccessor const& accessor) const;
  void chooseHaloDepth(std::uint64_t total);
  void countHalos();

  std::uint64_t structureSize(std::uint64_t rows) const;
  void makeTraversal(BufferMaker const& makeBuffer) const;
  void makeNeighbors(BufferMaker const& makeBuffer) const;

  void writeRoots(std::uint8_t* bytes) const;
  void writeTile(std::uint8_t* bytes, TileType const& tile) const;
  void writeBlockChildren(std::uint8_t* bytes, TileType const& bottom) const;
  std::uint32_t childNumber(TileType const& tile, int slot) const {
    TreeIndex const child = tile.childTreeIndex(slot);
    return child.index < 0 ? kNoTile : number(child.depth, child.index);
  }
  void reportSize() const;

  Tree const& m_tree;
  ConversionSettings const& m_settings;
  Log m_log;
  int m_maxDepth;
  int m_rootDepth = 0;
  int3 m_lowest{0, 0, 0};

  std::array<std::uint32_t, kTileCountAccumEntries> m_tileCountAccum{};
  /// By depth: numbers within the depth by index; empty where they are the indices.
  VLN::PerDepth<std::vector<std::uint32_t>, Traits::kDepths> m_order;
  VLN::PerDepth<CoalescedTiles, Traits::kDepths> m_coalesced;
  VLN::PerDepth<std::uint32_t, Traits::kDepths> m_counts{}; ///< numbers given at each depth
  std::uint64_t m_deadTiles = 0;

  std::uint64_t m_notFinest = 0; ///< numbers of tiles that may have children
  std::uint64_t m_withChildren = 0;
  /// By number: where the tile's child table lies; the last entry is the sentinel.
  std::vector<std::uint64_t> m_childOffsets;
  std::uint64_t m_size = 0;

  Halo m_halo = Halo::kNone;
  int m_haloDepth = 0;           ///< the depth in which the budget for halos ends
  std::int64_t m_haloBudget = 0; ///< tiles of that depth that may still have one
  std::uint64_t m_haloTiles = 0, m_plainTiles = 0;
  std::vector<std::uint32_t> m_halosBefore;
  std::vector<std::uint64_t> m_samplesBefore;
};

} // namespace nanovtt::Internal
