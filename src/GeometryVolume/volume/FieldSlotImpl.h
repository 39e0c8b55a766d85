// TypedSlot: what a volume holds of a field of one element type. Only the generated sources include this.
#pragma once

#include "GeometryVolume/channels/Halo.h"
#include "GeometryVolume/channels/NonLeafValues.h"
#include "GeometryVolume/core/ElementTypes.h"
#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/core/RollbackImpl.h"
#include "GeometryVolume/topology/Command.h"
#include "GeometryVolume/volume/FieldBulkImpl.h"
#include "GeometryVolume/volume/FieldPendingImpl.h"

#include <algorithm>
#include <array>
#include <bit>
#include <cstring>
#include <memory>
#include <span>
#include <stdexcept>
#include <string>
#include <utility>
#include <vector>

namespace VLN::TileTree3D {

namespace Internal {

inline constexpr int kFinest = VolumeShape::kMaxDepth;
inline constexpr std::size_t kTileElements = 64;
/// Blocks whose missing tiles a thread makes at a time.
inline constexpr std::int64_t kGroupBlocks = 64;

template <class T> struct TypedSlot;

template <class T> struct TypedChunkTiles final : ChunkTiles {
  TypedChunkTiles(TypedSlot<T> const& slot, VolumeTree const& tree, T const* first)
      : ChunkTiles({reinterpret_cast<std::uintptr_t>(first), sizeof(T)})
      , m_slot(slot)
      , m_tree(tree)
      , m_accessor(tree.tileAccessor())
      , m_values(first) {}
  void make(BlockTiles const& wanted) override {
    tiles.appendFew(std::size_t(std::popcount(wanted.slots)), [&](auto& group) {
      m_slot.makeElements(m_tree, m_accessor, {&wanted, 1}, group);
    });
  }
  void write(std::span<BulkRun const> runs, BulkPlace const* places) const override {
    for (BulkRun const& run : runs) writeRun(run, places + run.begin, m_values + run.begin);
  }
  void takeOut() noexcept override { m_slot.takeOut(tiles, 0); }

  PendingTiles<T> tiles;

private:
  TypedSlot<T> const& m_slot;
  VolumeTree const& m_tree;
  VolumeTree::ConstTileAccessor m_accessor;
  T const* m_values;
};

template <class T> struct TypedSlot final : FieldSlot {
  using ChannelType = Channel<VolumeShape, T, 4, 0>;
  using HaloChannelType = Channel<VolumeShape, T, 4, 1>;

  explicit TypedSlot(Ostil::Ptr<ChannelType> channel)
      : m_channel(std::move(channel)) {
    name = m_channel->name();
    for (std::size_t d = 0; d < m_filled.size(); ++d)
      m_filled[d] = static_cast<std::int64_t>(tiles()[d].size());
  }

  Ostil::Ptr<ChannelBase> channel() const override { return m_channel; }
  char const* typeName() const override { return kElementType<T>.name; }
  std::unique_ptr<FieldSlot> share() const override { return std::make_unique<TypedSlot>(m_channel); }

  void detach(VolumeData& volume) override {
    if (exclusive.load(std::memory_order_relaxed)) return;
    void const* const before = m_channel->tileArrays();
    makeUnique(m_channel);
    m_tiles = m_channel->cloneData().get();
    if (m_tiles != before) {
      blocksBuilt = false;
      version.store(0, std::memory_order_relaxed);
    }
    exclusive.store(true, std::memory_order_relaxed);
    volume.epoch.fetch_add(1, std::memory_order_relaxed);
  }

  void follow(VolumeData& volume) override {
    VolumeTree const& tree = *volume.tree;
    auto const missing = [&](int d) {
      return tree.tileCount(d) - static_cast<std::int64_t>(tiles()[d].size());
    };
    std::int64_t added = 0;
    for (int d = 0; d <= kFinest; ++d) added += std::max<std::int64_t>(0, missing(d));
    if (added > 0) detach(volume);
    if (added > kFewTiles && m_pending.empty()) {
      volume.updateTopology();
      m_channel->update(*volume.topology);
    }
    for (int d = 0; d < kFinest; ++d) {
      if (std::int64_t const n = missing(d); n > 0) m_channel->appendTiles(d, n);
      fillNew(tree, d);
    }
    if (!m_pending.empty()) {
      adoptPending(tree);
    } else {
      if (std::int64_t const n = missing(kFinest); n > 0) m_channel->appendTiles(kFinest, n);
      fillNew(tree, kFinest);
    }
    enterBlocks(tree);
    version.store(volume.version, std::memory_order_release);
  }

  bool hasPending() const override { return !m_pending.empty(); }
  void listPending(Ostil::Array<int3>& corners) const override {
    for (std::size_t n = 0; n < m_pending.groupCount(); ++n)
      for (PendingTile<T> const& tile : m_pending.group(n)) corners.append(tile.corner);
  }

  void makePending(VolumeData& volume, std::span<BlockTiles> tiles) override {
    std::size_t entered = 0;
    VLN::Internal::Rollback entries([&] {
      for (BlockTiles& made : tiles.first(entered)) {
        for (std::uint32_t left = made.slots; left; left &= left - 1)
          made.block->tiles[std::countr_zero(left)].storeRelaxed(nullptr);
      }
    });
    if (tiles.size() > 1) blocks.reserve(tiles.size());
    for (std::size_t n = 0; n < tiles.size(); ++n) {
      if (n + kAhead < tiles.size()) blocks.prefetch(tiles[n + kAhead].position);
      BlockTiles& wanted = tiles[n];
      wanted.block = &blocks.make(wanted.position);
      for (std::uint32_t left = wanted.slots; left; left &= left - 1) {
        auto& entry = wanted.block->tiles[std::countr_zero(left)];
        if (entry.loadRelaxed())
          wanted.slots &= ~(left & -left);
        else
          entry.storeRelaxed(this); // so that it is listed once
      }
      ++entered;
    }
    if (tiles.size() == 1)
      m_pending.appendFew(std::size_t(std::popcount(tiles[0].slots)),
                          [&](auto& group) { makeElements(*volume.tree, volume.reader(), tiles, group); });
    else
      m_pending.append(
          static_cast<std::size_t>(chunkCount(0, std::ssize(tiles), kGroupBlocks)), [&](auto* groups) {
            parallelChunks(0, std::ssize(tiles), kGroupBlocks, [&](auto n, auto begin, auto end) {
              makeGroup(*volume.tree, tiles.subspan(std::size_t(begin), std::size_t(end - begin)), groups[n]);
            });
          });
    entries.dismiss();
    volume.pending.store(true, std::memory_order_release);
  }

  void adopt(VolumeData& volume, std::span<std::unique_ptr<ChunkTiles>> chunks) override {
    std::vector<PendingTiles<T>*> tiles;
    for (auto const& chunk : chunks) tiles.push_back(&static_cast<TypedChunkTiles<T>&>(*chunk).tiles);
    m_pending.take(tiles);
    volume.pending.store(true, std::memory_order_release);
  }
  std::size_t pendingGroups() const override { return m_pending.groupCount(); }
  void dropUnentered(std::size_t first) override {
    parallelFor(static_cast<std::int64_t>(first), static_cast<std::int64_t>(m_pending.groupCount()),
                [&](std::int64_t begin, std::int64_t end) {
                  for (auto n = begin; n < end; ++n)
                    std::erase_if(m_pending.group(static_cast<std::size_t>(n)),
                                  [&](PendingTile<T> const& tile) {
                                    int3 const& p = tile.corner;
                                    return blocks.tile(p.x, p.y, p.z) != tile.elements.data();
                                  });
                });
  }
  void dropGroups(std::size_t first) noexcept override {
    takeOut(m_pending, first);
    m_pending.cutBack(first);
  }

  void tilesRemoved(VolumeData& volume, TileRemovalList const& moves) override {
    detach(volume);
    m_channel->updateTilesRemoved(moves, *volume.topology);
    m_tiles = m_channel->cloneData().get();
    for (int d = 0; d <= kFinest; ++d) m_filled[d] = volume.tree->tileCount(d);
    blocksBuilt = false;
    enterBlocks(*volume.tree);
    written.store(true, std::memory_order_relaxed);
    version.store(volume.version, std::memory_order_release);
  }

  void fillCoarse(VolumeData& volume) override {
    setNonLeafValueToChildValue(*m_channel, *volume.tree, volume.topology->offsetType(), 0, kFinest - 1);
    volume.valuesChanged(*this);
  }

  void fillHalo(VolumeData& volume) override {
    std::string const haloName = name + "_halo";
    if (!volume.rest.component<HaloChannelType>(haloName))
      Command::createChannel<T, 2, 4, 4, 0, 1>(haloName, *volume.topology, volume.rest,
                                               m_channel->defaultValue(), kInitializeDefaultValue, 0,
                                               kFinest);
    auto halo = volume.rest.extractComponent<HaloChannelType>(haloName);
    computeHalo<VolumeShape, T, 0, 0, 0, 1>(*m_channel, *volume.tree, *halo, -1, -1);
    volume.rest.putComponent(std::move(halo));
  }

  /// Makes elements and enters them.
  void makeElements(VolumeTree const& tree, VolumeTree::ConstTileAccessor const& accessor,
                    std::span<BlockTiles const> tiles, typename PendingTiles<T>::Group& out) const {
    bool const grown = tree.tileCount(-1) > 0;
    for (std::size_t n = 0; n < tiles.size(); ++n) {
      if (n + kAhead < tiles.size())
        __builtin_prefetch(tiles[n + kAhead].block, 1); // another thread's so far
      BlockTiles const& block = tiles[n];
      TreeIndex above; // the deepest tile of the tree there
      bool ofAll = !grown;
      for (std::uint32_t left = block.slots; left; left &= left - 1) {
        auto const slot = static_cast<std::size_t>(std::countr_zero(left));
        int3 const p = FieldBlock::tileCorner(block.position, slot);
        if (!ofAll) above = accessor.treeIndex(p.x, p.y, p.z, kFinest, false);
        ofAll = ofAll || above.depth < kFinest - 1; // the block is a tile of that depth
        TileVector<T> elements = m_channel->newTile();
        if (above.depth == kFinest || elements.size() < kTileElements)
          throw std::logic_error("field \"" + name + "\": a tile holds no elements");
        if (above.valid()) fillFromCoarse(tree, above, p, elements);
        out.emplace_back(p, std::move(elements));
        block.block->tiles[slot].storeRelease(out.back().elements.data());
      }
    }
  }
  /// Takes the tiles of the groups from `first` on out of `blocks`.
  void takeOut(PendingTiles<T> const& pending, std::size_t first) const noexcept {
    for (std::size_t n = first; n < pending.groupCount(); ++n)
      for (PendingTile<T> const& tile : pending.group(n)) {
        int3 const& p = tile.corner;
        if (FieldBlock* const block = blocks.find(p.x, p.y, p.z); block != FieldBlocks::noBlock())
          block->tiles[FieldBlock::place(p.x, p.y, p.z).slot()].storeRelease(nullptr);
      }
  }
  TileArrays<T> const& tiles() const { return *std::as_const(*m_channel).tileArrays(); }
  TileVector<T> const& tile(TreeIndex const& at) const { return tiles()[at.depth][at.index]; }
  ChannelType& typed() { return *m_channel; }

private:
  /// New tiles take the values of the coarser samples that were read at their places.
  void fillNew(VolumeTree const& tree, int depth) {
    std::int64_t const begin = m_filled[depth], end = static_cast<std::int64_t>(tiles()[depth].size());
    if (begin >= end) return;
    if (depth > 0) {
      auto const body = [&](std::int64_t b, std::int64_t e) {
        for (auto n = b; n < e; ++n) fillFromParent(tree, {n, depth}, (*m_tiles)[depth][n]);
      };
      if (end - begin < kFewTiles)
        body(begin, end);
      else
        parallelFor(begin, end, body, {.grain = kFewTiles});
    }
    m_filled[depth] = end;
  }
  void fillFromParent(VolumeTree const& tree, TreeIndex const& place, TileVector<T>& to) {
    auto const& made = tree.tile(place);
    if (!made.valid() || made.isRoot()) return;
    TreeIndex const above = made.parentTreeIndex();
    TileVector<T> const& from = tile(above);
    if (from.size() < kTileElements || to.size() < kTileElements) return;
    int3 const slot = tree.tile(above).childIJK(made);
    std::size_t const first = ConstTileData<T, 4, 0>::index(2 * slot.x, 2 * slot.y, 2 * slot.z);
    T const* const p = from.data() + first;
    T const& value = m_channel->defaultValue();
    auto const same = [&](std::size_t at) { return std::memcmp(p + at, &value, sizeof(T)) == 0; };
    if (same(0) && same(1) && same(4) && same(5) && same(16) && same(17) && same(20) && same(21)) return;
    for (std::size_t at = 0; at < kTileElements; ++at)
      to[at] = p[(at & 3) / 2 + (at >> 2 & 3) / 2 * 4 + (at >> 4) / 2 * 16];
  }
  /// The same for a tile with missing ones above it: from the tile `at`, the deepest there is.
  void fillFromCoarse(VolumeTree const& tree, TreeIndex at, int3 const& corner, TileVector<T>& to) const {
    while (at.valid() && tile(at).size() < kTileElements) at = tree.tile(at).parentTreeIndex();
    if (!at.valid()) return;
    TileVector<T> const& from = tile(at);
    // Samples above the deepest depth are two elements wide or wider.
    auto const& above = tree.tile(at);
    int3 const p[2] = {above.childDataIJK(corner), above.childDataIJK(corner + int3{2, 2, 2})};
    for (std::size_t n = 0; n < kTileElements; ++n)
      to[n] = from[ConstTileData<T, 4, 0>::index(p[n >> 1 & 1].x, p[n >> 3 & 1].y, p[n >> 5].z)];
  }

  void makeGroup(VolumeTree const& tree, std::span<BlockTiles const> tiles,
                 typename PendingTiles<T>::Group& out) {
    std::size_t count = 0;
    for (BlockTiles const& block : tiles) count += static_cast<std::size_t>(std::popcount(block.slots));
    out.reserve(count);
    makeElements(tree, tree.tileAccessor(), tiles, out);
  }
  /// Makes the finest tiles of the tree that the channel lacks, pending ones by handing over their elements.
  /// What is thrown leaves all as it was.
  void adoptPending(VolumeTree const& tree) {
    auto const first = static_cast<std::int64_t>(tiles()[kFinest].size());
    std::vector<TileVector<T>> arriving(tree.tileCount(kFinest) - first);
    parallelFor(0, static_cast<std::int64_t>(m_pending.groupCount()),
                [&](std::int64_t begin, std::int64_t end) {
                  auto const accessor = tree.tileAccessor();
                  for (auto n = begin; n < end; ++n)
                    for (PendingTile<T>& tile : m_pending.group(static_cast<std::size_t>(n))) {
                      int3 const& p = tile.corner;
                      tile.arrival = accessor.treeIndex(p.x, p.y, p.z, kFinest, true).index - first;
                    }
                },
                {.grain = 4});
    auto const swapAll = [&] {
      for (std::size_t n = 0; n < m_pending.groupCount(); ++n)
        for (PendingTile<T>& tile : m_pending.group(n)) arriving[tile.arrival].swap(tile.elements);
    };
    swapAll();
    VLN::Internal::Rollback swapped(swapAll);
    parallelFor(0, static_cast<std::int64_t>(arriving.size()),
                [&](std::int64_t begin, std::int64_t end) {
                  for (auto n = begin; n < end; ++n) {
                    auto& elements = arriving[n];
                    if (!elements.empty()) continue;
                    elements = m_channel->newTile();
                    fillFromParent(tree, {first + n, kFinest}, elements);
                  }
                },
                {.grain = kFewTiles});
    m_channel->appendTiles(kFinest, arriving);
    swapped.dismiss();
    m_pending.clear();
    m_filled[kFinest] = tree.tileCount(kFinest);
  }
  /// Enters the finest tiles that the table lacks.
  void enterBlocks(VolumeTree const& tree) {
    if (!blocksBuilt) {
      blocks.clear();
      m_entered = 0;
    }
    auto const& finest = tiles()[kFinest];
    auto const count = std::min(static_cast<std::int64_t>(finest.size()), tree.tileCount(kFinest));
    // Most blocks hold several tiles; those that do not make the table grow.
    if (count - m_entered > kFewTiles) blocks.reserve(static_cast<std::size_t>(count - m_entered) / 4);
    for (; m_entered < count; ++m_entered) {
      auto const& at = tree.tile(m_entered, kFinest);
      TileVector<T> const& elements = finest[m_entered];
      if (at.valid() && elements.size() >= kTileElements)
        blocks.entry(at.tijk()).storeRelease(const_cast<T*>(elements.data()));
    }
    blocksBuilt = true;
  }

  Ostil::Ptr<ChannelType> m_channel;
  TileArrays<T>* m_tiles = nullptr; ///< of the channel, while it is exclusive
  DepthCounts m_filled{};           ///< tiles that hold what they should
  std::int64_t m_entered = 0;       ///< finest tiles in the table
  PendingTiles<T> m_pending;
};

} // namespace Internal

} // namespace VLN::TileTree3D
