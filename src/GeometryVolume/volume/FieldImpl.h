// Definitions of Field and of the slot behind it. Only the generated sources include this.
#pragma once

#include "GeometryVolume/channels/Halo.h"
#include "GeometryVolume/channels/ManyReadsImpl.h"
#include "GeometryVolume/channels/NonLeafValues.h"
#include "GeometryVolume/core/ElementTypes.h"
#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/core/RollbackImpl.h"
#include "GeometryVolume/sampling/VoxelSamplerLinear.h"
#include "GeometryVolume/topology/Command.h"
#include "GeometryVolume/volume/FieldBulkImpl.h"
#include "GeometryVolume/volume/FieldPendingImpl.h"
#include "GeometryVolume/volume/Volume.h"

#include <algorithm>
#include <array>
#include <bit>
#include <cstring>
#include <stdexcept>
#include <utility>

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

template <class T> struct Field<T>::Sampler {
  FloatVoxelSamplerLinear<Internal::VolumeShape> linear;
  std::uint64_t epoch, version, values;
};

template <class T>
Field<T>::Field(Field const& other)
    : m_volume(other.m_volume)
    , m_slot(other.m_slot)
    , m_block(other.m_block)
    , m_at(other.m_at)
    , m_readEpoch(other.m_readEpoch)
    , m_writeEpoch(other.m_writeEpoch) {}
template <class T> Field<T>::Field(Field&& other) noexcept = default;
template <class T> Field<T>& Field<T>::operator=(Field const& other) {
  if (this != &other) *this = Field(other);
  return *this;
}
template <class T> Field<T>& Field<T>::operator=(Field&& other) noexcept = default;
template <class T> Field<T>::~Field() = default;

namespace Internal {
inline void checkCounts(std::string const& field, std::size_t positions, std::size_t values) {
  if (positions != values)
    throw std::invalid_argument("field \"" + field + "\": " + std::to_string(positions) + " positions with " +
                                std::to_string(values) + " values");
}
template <class T> TypedSlot<T>& typed(FieldSlot& slot) { return static_cast<TypedSlot<T>&>(slot); }
} // namespace Internal

template <class T> T const& Field<T>::background() const {
  return Internal::typed<T>(*m_slot).typed().defaultValue();
}

template <class T> inline void Field<T>::findBlock(int i, int j, int k) const {
  m_readEpoch = m_volume->epoch.load(std::memory_order_relaxed);
  m_writeEpoch = m_slot->exclusive.load(std::memory_order_relaxed) ? m_readEpoch : 0;
  m_at = {i & ~7, j & ~7, k & ~7};
  m_block = m_slot->blocks.find(i, j, k);
}

template <class T> void Field<T>::moveToRead(int i, int j, int k) const {
  m_volume->sync(*m_slot);
  findBlock(i, j, k);
}

template <class T> void Field<T>::moveToWrite(int i, int j, int k) {
  m_volume->prepareWrite(*m_slot);
  findBlock(i, j, k);
}

template <class T> T* Field<T>::make(int i, int j, int k) {
  // Another handle may have made the block.
  if (m_block == Internal::FieldBlocks::noBlock()) findBlock(i, j, k);
  if (!m_block->tile(i, j, k)) {
    int3 const p{i, j, k};
    if (!Internal::VolumeShape::inDomain(p)) Internal::throwOutside(p);
    Internal::BlockTiles tile{p, 1u << Internal::FieldBlock::place(i, j, k).slot()};
    Internal::typed<T>(*m_slot).makePending(*m_volume, {&tile, 1});
    findBlock(i, j, k);
  }
  return static_cast<T*>(m_block->tile(i, j, k));
}

template <class T> T Field<T>::coarse(int i, int j, int k) const {
  using namespace Internal;
  moveToRead(i, j, k); // the tile may have been made through another handle
  auto const place = FieldBlock::place(i, j, k);
  if (auto const* const tile = static_cast<T const*>(m_block->tile(place))) return tile[place.element()];
  auto& slot = typed<T>(*m_slot);
  auto const accessor = std::as_const(*m_volume->tree).tileAccessor();
  TreeIndex at = accessor.treeIndex(i, j, k, kFinest, false);
  while (at.valid()) {
    auto const& elements = slot.tile(at);
    auto const& tile = accessor.tile(at);
    if (elements.size() >= kTileElements) {
      int3 const p = tile.childDataIJK(i, j, k);
      return elements[ConstTileData<T, 4, 0>::index(p)];
    }
    at = tile.parentTreeIndex();
  }
  return slot.typed().defaultValue();
}

template <class T> void Field<T>::set(std::span<int3 const> positions, std::span<T const> values) {
  using namespace Internal;
  checkCounts(m_slot->name, positions.size(), values.size());
  auto const& slot = typed<T>(*m_slot);
  auto const chunkTiles = [&](std::size_t first) {
    return std::make_unique<TypedChunkTiles<T>>(slot, *m_volume->tree, values.data() + first);
  };
  if (isAtRandom(positions)) {
    ScatteredElements const found = findScattered(*m_volume, *m_slot, positions, chunkTiles);
    m_volume->valuesChanged(*m_slot);
    parallelFor(0, static_cast<std::int64_t>(found.shares), [&](std::int64_t begin, std::int64_t end) {
      for (auto share = begin; share < end; ++share) found.write(share, values.data());
    });
    return;
  }
  BulkRuns const plan = planBulk(*m_volume, *m_slot, positions, chunkTiles);
  m_volume->valuesChanged(*m_slot);
  parallelFor(0, static_cast<std::int64_t>(plan.shares), [&](std::int64_t begin, std::int64_t end) {
    for (auto share = begin; share < end; ++share)
      for (std::size_t chunk = 0; chunk < plan.chunks(); ++chunk) {
        std::size_t const first = plan.begins[chunk];
        for (BulkRun const& run : plan.list(chunk, share))
          writeRun(run, &plan.places[first + run.begin], values.data() + first + run.begin);
      }
  });
}

template <class T> void Field<T>::get(std::span<int3 const> positions, std::span<T> values) const {
  using namespace Internal;
  checkCounts(m_slot->name, positions.size(), values.size());
  m_volume->sync(*m_slot);
  auto const& blocks = m_slot->blocks;
  using Size = std::integral_constant<std::size_t, sizeof(T)>;
  constexpr std::int64_t kGrain = 1 << 14;
  parallelFor(
      0, std::ssize(positions),
      [&](std::int64_t begin, std::int64_t end) {
        Field const own(*this); // for what each thread remembers
        auto const first = static_cast<std::size_t>(begin), count = static_cast<std::size_t>(end - begin);
        ManyReads<FieldBlock, Size> reads({sizeof(T), 4, 0}, Size());
        reads.read(
            positions.subspan(first, count), [&](int3 const& p) { blocks.prefetch(p); },
            [&](int3 const& p) -> FieldBlock const* { return blocks.find(p.x, p.y, p.z); },
            values.data() + first, [&](std::size_t n) { values[first + n] = own.get(positions[first + n]); });
      },
      {.grain = kGrain});
}

template <class T> void Field<T>::fill(T const& value) {
  T const copy = value;
  auto& channel = editChannel();
  for (T& element : channel) element = copy;
}

template <class T> void const* Field<T>::sampler() const {
  if constexpr (std::is_same_v<T, float>) {
    m_volume->syncTree();
    auto const epoch = m_volume->epoch.load(std::memory_order_relaxed);
    if (m_slot->written.load(std::memory_order_acquire)) {
      std::lock_guard const lock(m_volume->mutex);
      if (m_slot->written.load(std::memory_order_relaxed)) {
        m_slot->values.fetch_add(1, std::memory_order_release);
        m_slot->written.store(false, std::memory_order_release);
      }
    }
    auto const values = m_slot->values.load(std::memory_order_acquire);
    if (!m_sampler || m_sampler->epoch != epoch || m_sampler->version != m_volume->version ||
        m_sampler->values != values) {
      m_volume->sync();
      m_sampler.reset(new Sampler{{*m_volume->tree, *m_volume->topology, channel()},
                                  m_volume->epoch.load(std::memory_order_relaxed),
                                  m_volume->version,
                                  values});
    }
    return &m_sampler->linear;
  } else {
    return nullptr;
  }
}

template <class T>
float Field<T>::sample(float3 const& position, SamplerSpace space) const requires SampledElement<T> {
  return static_cast<FloatVoxelSamplerLinear<Internal::VolumeShape> const*>(sampler())->sample(position,
                                                                                               space);
}

template <class T>
void Field<T>::sample(std::span<float3 const> positions, std::span<float> values,
                      SamplerSpace space) const requires SampledElement<T> {
  Internal::checkCounts(m_slot->name, positions.size(), values.size());
  static_cast<FloatVoxelSamplerLinear<Internal::VolumeShape> const*>(sampler())->sample(
      positions.data(), values.data(), static_cast<std::int64_t>(positions.size()),
      Internal::VolumeShape::kMaxDepth, space);
}

template <class T>
float3 Field<T>::gradient(float3 const& position, SamplerSpace space) const requires SampledElement<T> {
  float3 out;
  static_cast<FloatVoxelSamplerLinear<Internal::VolumeShape> const*>(sampler())->sampleGradient(position,
                                                                                                space, &out);
  return out;
}

template <class T> auto Field<T>::channel() const -> ChannelType const& {
  m_volume->sync(*m_slot);
  return Internal::typed<T>(*m_slot).typed();
}

template <class T> auto Field<T>::editChannel() -> ChannelType& {
  m_volume->sync();
  m_volume->prepareWrite(*m_slot);
  m_volume->valuesChanged(*m_slot);
  return Internal::typed<T>(*m_slot).typed();
}

template <class T> auto Field<T>::halos() const -> Channel<Internal::VolumeShape, T, 4, 1> const& {
  m_volume->sync();
  auto const found =
      m_volume->rest.template component<Channel<Internal::VolumeShape, T, 4, 1>>(m_slot->name + "_halo");
  if (!found) throw std::logic_error("field \"" + m_slot->name + "\": fill its halos first");
  return *found;
}

template <class T> void Field<T>::forEachTileRange(RangeBody body) {
  editChannel();
  std::as_const(*this).forEachTileRange(body);
}

template <class T> void Field<T>::forEachTileRange(RangeBody body) const {
  m_volume->sync();
  parallelFor(0, std::as_const(*m_volume->tree).tileCount(Internal::kFinest), body, {.grain = 64});
}

template <class T> TileBlock<T> Field<T>::tileBlock(std::int64_t n) const {
  auto const& tile = std::as_const(*m_volume->tree).tile(n, Internal::kFinest);
  auto const& elements = Internal::typed<T>(*m_slot).tile({n, Internal::kFinest});
  bool const whole = tile.valid() && elements.size() >= Internal::kTileElements;
  return {tile.tijk(), whole ? const_cast<T*>(elements.data()) : nullptr};
}

template <class T> void Field<T>::gather(std::int64_t n, Stencil<T>& out) const {
  using namespace Internal;
  int3 const at = std::as_const(*m_volume->tree).tile(n, kFinest).tijk();
  out.corner = at;
  auto const& blocks = m_slot->blocks;
  for (int dk = -1; dk <= 1; ++dk)
    for (int dj = -1; dj <= 1; ++dj)
      for (int di = -1; di <= 1; ++di) {
        int const x = at.x + 4 * di, y = at.y + 4 * dj, z = at.z + 4 * dk;
        auto const first = [](int d) { return d < 0 ? 3 : 0; };
        auto const width = [](int d) { return d ? 1 : 4; };
        auto const to = [](int d) { return d < 0 ? -1 : d == 0 ? 0 : 4; };
        auto const* const from = static_cast<T const*>(blocks.tile(x, y, z));
        for (int k = 0; k < width(dk); ++k)
          for (int j = 0; j < width(dj); ++j) {
            T* const row = out.values + Stencil<T>::index(to(di), to(dj) + j, to(dk) + k);
            int const fj = first(dj) + j, fk = first(dk) + k;
            for (int i = 0; i < width(di); ++i)
              row[i] =
                  from ? from[first(di) + i + 4 * (fj + 4 * fk)] : coarse(x + first(di) + i, y + fj, z + fk);
          }
      }
}

template <class T>
Field<T> Volume::addField(std::string const& name, std::type_identity_t<T> const& background) {
  using namespace Internal;
  checkNewName(name);
  m_data->sync();
  Ostil::Ptr<Channel<VolumeShape, T, 4, 0>> channel = Command::createChannel<T, 2, 4, 4, 0, 0>(
      name, *m_data->topology, background, kInitializeDefaultValue, 0, kFinest);
  return Field<T>(*m_data, addSlot(std::make_unique<TypedSlot<T>>(std::move(channel))));
}

template <class T> Field<T> Volume::field(std::string const& name) const {
  auto& slot = findSlot(name);
  if (!dynamic_cast<Internal::TypedSlot<T>*>(&slot))
    throw std::invalid_argument("field \"" + name + "\" holds " + slot.typeName() + ", not " +
                                kElementType<T>.name);
  return Field<T>(*m_data, slot);
}

template <class T> bool Volume::hasField(std::string const& name) const {
  return dynamic_cast<Internal::TypedSlot<T>*>(m_data->find(name)) != nullptr;
}

} // namespace VLN::TileTree3D
