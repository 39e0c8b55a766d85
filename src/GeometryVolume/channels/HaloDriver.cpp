#include "GeometryVolume/channels/HaloDriverImpl.h"

#include <algorithm>
#include <bit>
#include <utility>

namespace VLN::TileTree3D::Internal {

template <class TraitsT>
TreeIndex HaloDriver<TraitsT>::searchNeighbor(TileType const& tile, NeighborDirection direction) const {
  int3 const step = neighborOffset(direction);
  std::int64_t const w = TraitsT::width(tile.depth());
  std::int64_t const i = tile.ti() + step.x * w, j = tile.tj() + step.y * w, k = tile.tk() + step.z * w;
  auto const outside = [](std::int64_t c) {
    return c < TraitsT::kMinTileCoord || c > TraitsT::kMaxTileCoord;
  };
  if (outside(i) || outside(j) || outside(k)) return {};
  return m_accessor.treeIndex(static_cast<int>(i), static_cast<int>(j), static_cast<int>(k), tile.depth(),
                              false);
}

// One number: three that return as one record are stored and loaded in different pieces, which waits for all
// earlier stores.
template <class TraitsT> int HaloDriver<TraitsT>::slotInParentBlock(TileType const& tile) {
  int const d = tile.depth();
  if (d == 0) return blockSlot({0, 0, 0});
  auto const slot = [d](int c) {
    std::uint32_t const u = TraitsT::offset(c);
    if constexpr (TraitsT::kTW == 2) return static_cast<int>(TraitsT::quotient(u, d) & 1);
    return static_cast<int>(TraitsT::quotient(u, d) - TraitsT::kTW * TraitsT::quotient(u, d - 1));
  };
  return blockSlot({slot(tile.ti()), slot(tile.tj()), slot(tile.tk())});
}

template <class TraitsT> void HaloDriver<TraitsT>::setTile(TileType const& tile) {
  if constexpr (Block::kOfParent)
    m_parentCache = tile.isRoot() ? nullptr : &blockOf(tile).cache;
  else
    m_parentCache = tile.isRoot() ? nullptr : &cacheOf(tile.parentTreeIndex());
  m_blockSlot = slotInParentBlock(tile);
}

template <class TraitsT> void HaloDriver<TraitsT>::findPlaces(NeighborCache& cache, std::uint32_t steps) {
  auto const& tile = m_accessor.tile(cache.tile);
  NeighborCache* const parent = tile.isRoot() ? nullptr : &cacheOf(tile.parentTreeIndex());
  int const own = slotInParentBlock(tile), depth = cache.tile.depth;
  TileType const* const first = &m_accessor.container()->tile(0, depth);
  cache.known |= steps, cache.open |= steps;
  for (; steps; steps &= steps - 1) {
    auto const step = static_cast<NeighborDirection>(std::countr_zero(steps));
    OwnerTile& found = cache.around[step];
    found.children = nullptr;
    if (step == kNeighborSelf) {
      found.index = cache.tile.index, found.depth = depth;
      continue;
    }
    int const slot = own + kBlockSteps<TraitsT::kTW>[static_cast<std::size_t>(step)];
    NeighborSlot const& in = neighborSlot(slot);
    std::int64_t const child = parent ? ownerOf(*parent, in).children[in.slot] : -1;
    if (child >= 0) {
      found.index = child, found.depth = depth;
      __builtin_prefetch(first + child);
    } else {
      TreeIndex const there = parent ? childAt(*parent, slot, tile, step) : searchNeighbor(tile, step);
      found.index = there.index, found.depth = there.depth;
    }
  }
}

template <class TraitsT> void HaloDriver<TraitsT>::findChildren(NeighborCache& cache) {
  TileType const* const first = &m_accessor.container()->tile(0, cache.tile.depth);
  for (std::uint32_t steps = std::exchange(cache.open, 0); steps; steps &= steps - 1) {
    OwnerTile& owner = cache.around[std::countr_zero(steps)];
    if (owner.depth == cache.tile.depth) owner.children = first[owner.index].children();
    if (!owner.children) {
      owner.children = kNoChildren<TraitsT::kTileSize>.data();
      continue;
    }
    __builtin_prefetch(owner.children);
    __builtin_prefetch(owner.children + TraitsT::kTileSize - 1);
  }
}

namespace {

// What is read in place of a tile that is not there: as many bytes as the largest of all tiles has.
alignas(64) constexpr std::byte kNoElements[std::size_t(HaloTable::kLargestWidth) * HaloTable::kLargestWidth *
                                            HaloTable::kLargestWidth * kLargestElement]{};

} // namespace

template <class TraitsT> void HaloDriver<TraitsT>::listIndices(ParentBlock& block, BlockIndices& to) const {
  std::size_t count = 0;
  for (std::uint32_t owners = block.wanted & ~block.filled; owners; owners &= owners - 1) {
    auto const d = static_cast<std::size_t>(std::countr_zero(owners));
    OwnerTile const& owner = block.cache.around[d];
    if (owner.depth < 0) block.beyond |= 1u << d;
    if (owner.depth != block.cache.tile.depth) continue;
    for (NeighborPlace const& at : kNeighborPlaces<TraitsT::kTW>[d]) {
      if (at.place == NeighborPlace::kEnd) break;
      to.index[count] = owner.children[at.slot], to.place[count] = at.place;
      count += to.index[count] >= 0;
    }
  }
  to.count = static_cast<int>(count);
}

template <class TraitsT>
void HaloDriver<TraitsT>::completeBlocks(int depth, ParentBlock* blocks, std::size_t count) {
  std::array<BlockIndices, kBlocks> lists;
  for (std::size_t b = 0; b < count; ++b)
    findPlaces(blocks[b].cache, blocks[b].wanted & ~blocks[b].cache.known);
  for (std::size_t b = 0; b < count; ++b) findChildren(blocks[b].cache);
  for (std::size_t b = 0; b < count; ++b) {
    listIndices(blocks[b], lists[b]);
    m_source.fetchRecords(depth, lists[b].index.data(), lists[b].count);
  }
  for (std::size_t b = 0; b < count; ++b) {
    ParentBlock& block = blocks[b];
    BlockIndices const& list = lists[b];
    std::array<void const*, Block::kSize> found;
    m_source.elements(depth, list.index.data(), list.count, found.data());
    for (std::size_t n = 0; n < static_cast<std::size_t>(list.count); ++n) {
      if (!found[n]) continue;
      block.elements.at[list.place[n]] = found[n];
      block.elements.present |= std::uint64_t(1) << list.place[n];
      if (count > 1)
        for (int line = 0; line < 4; ++line)
          __builtin_prefetch(static_cast<std::byte const*>(found[n]) + 64 * line);
    }
    block.filled |= block.wanted;
  }
}

template <class TraitsT> auto HaloDriver<TraitsT>::blockOf(TileType const& tile) -> ParentBlock& {
  TreeIndex const parent = tile.parentTreeIndex();
  for (; m_block < m_blockCount; ++m_block)
    if (m_blocks[m_block].cache.tile == parent) return m_blocks[m_block];
  m_block = 0, m_blockCount = 1;
  return startBlock(m_blocks[0], parent);
}

template <class TraitsT>
auto HaloDriver<TraitsT>::startBlock(ParentBlock& block, TreeIndex const& parent) -> ParentBlock& {
  block.cache.tile = parent, block.cache.known = 0;
  block.wanted = block.filled = block.beyond = 0;
  block.elements.present = 0;
  block.elements.at.fill(kNoElements);
  return block;
}

template <class TraitsT>
void HaloDriver<TraitsT>::prepare(TileType const& first, UntypedTiles const& target) {
  if (!Block::kOfParent || first.isRoot()) return;
  TreeIndex const parent = first.parentTreeIndex();
  for (std::size_t b = m_block; b < m_blockCount; ++b)
    if (m_blocks[b].cache.tile == parent) return;
  auto const& tree = *m_accessor.container();
  int const depth = first.depth();
  std::int64_t const end =
      std::min(tree.tileCount(depth), first.index() + std::int64_t(kBlocks) * TraitsT::kTileSize);
  m_block = m_blockCount = 0;
  for (std::int64_t n = first.index(); n < end; ++n) {
    TileType const& tile = tree.tile(n, depth);
    if (!tile.valid() || tile.isRoot()) continue;
    TreeIndex const at = tile.parentTreeIndex();
    if (m_blockCount == 0 || m_blocks[m_blockCount - 1].cache.tile != at) {
      if (m_blockCount == kBlocks) break;
      startBlock(m_blocks[m_blockCount++], at);
    }
    m_blocks[m_blockCount - 1].wanted |= ownersRound(slotInParentBlock(tile));
  }
  completeBlocks(depth, m_blocks.data(), m_blockCount);
  for (std::size_t b = 0; b < m_blockCount; ++b) target.fetch(m_blocks[b].cache.tile);
}

template <class TraitsT> void HaloDriver<TraitsT>::findAlone(TileType const& tile) {
  std::array<std::int64_t, 27> indices;
  std::array<void const*, 27> found;
  auto const count = static_cast<std::size_t>(m_table.regionCount);
  for (std::size_t n = 0; n < count; ++n) indices[n] = neighborIndex(tile, m_table.regions[n]);
  indices[count] = tile.index();
  m_source.elements(tile.depth(), indices.data(), m_table.regionCount + 1, found.data());
  m_alone.present = 0;
  for (std::size_t n = 0; n <= count; ++n) {
    auto const place = static_cast<std::size_t>(Block::kFirst + (n < count ? m_table.regions[n].around : 0));
    m_alone.at[place] = found[n] ? found[n] : kNoElements;
    m_alone.present |= std::uint64_t(found[n] != nullptr) << place;
  }
}

template <class TraitsT> auto HaloDriver<TraitsT>::elementsAround(TileType const& tile) -> Around {
  Elements const* block = &m_alone;
  int own = Block::kFirst;
  if constexpr (Block::kOfParent) {
    if (m_parentCache) {
      ParentBlock& there = m_blocks[m_block];
      std::uint32_t const owners = ownersRound(m_blockSlot);
      if (owners & ~there.filled) there.wanted |= owners, completeBlocks(tile.depth(), &there, 1);
      if (!(owners & there.beyond) || m_accessor.container()->rootCount(tile.depth()) == 0)
        block = &there.elements, own = m_blockSlot;
    }
  }
  if (block == &m_alone) findAlone(tile);
  std::uint64_t const present = block->present >> (own - Block::kFirst);
  return {block->at.data() + own, m_table.around & ~present, bool(present >> Block::kFirst & 1)};
}

template <class TraitsT>
auto HaloDriver<TraitsT>::ancestorWithData(TileType const* tile, void const*& elements) const
    -> TileType const* {
  while (tile->valid() && tile->depth() >= m_source.minDepth) {
    elements = m_source.elements(tile->treeIndex());
    if (elements) return tile;
    if (tile->isRoot()) break;
    tile = &m_accessor.tile(tile->parentTreeIndex());
  }
  return nullptr;
}

template <class TraitsT>
void HaloDriver<TraitsT>::copy(HaloBox const& box, void* target, void const* source) const {
  m_source.ops->kernels->copy(
      {at(target, box.target), m_table.targetWidth, at(source, box.source), m_table.sourceWidth, box.count});
}

template <class TraitsT>
void HaloDriver<TraitsT>::set(HaloBox const& box, void* target, void const* value) const {
  m_source.ops->kernels->fill({at(target, box.target), m_table.targetWidth, value, 0, box.count});
}

template <class TraitsT> void HaloDriver<TraitsT>::replicate(HaloBox const& box, void* target) const {
  int flat[3][HaloTable::kLargestWidth];
  int stride = 1;
  for (std::size_t a = 0; a < 3; ++a, stride *= m_table.targetWidth)
    for (int n = 0; n < box.count[a]; ++n)
      flat[a][n] = stride * std::clamp(box.low[a] + n, 0, m_table.tileDataWidth - 1);
  m_source.ops->kernels->gather({at(target, box.target), m_table.targetWidth,
                                 at(target, m_table.targetOrigin), flat[0], flat[1], flat[2], box.count});
}

template <class TraitsT>
void HaloDriver<TraitsT>::blend(std::uint64_t missing, void* target, void const* parent) const {
  auto const axis = [&](int slot) { return m_table.parentAxis[slot % kAcross - 1].data() + m_table.halo; };
  HaloAxis const* const i = axis(m_blockSlot);
  HaloAxis const* const j = axis(m_blockSlot / kAcross);
  HaloAxis const* const k = axis(m_blockSlot / (kAcross * kAcross));
  m_source.ops->blendParent({target, at(parent, m_table.targetOrigin), &m_table, i, j, k}, missing);
}

template <class TraitsT>
void HaloDriver<TraitsT>::nearest(HaloBox const& box, TileType const& tile, void* target,
                                  TileType const& coarse, void const* source) const {
  int flat[3][HaloTable::kLargestWidth];
  int stride = 1;
  for (int a = 0; a < 3; ++a, stride *= m_table.sourceWidth) {
    for (int n = 0; n < box.count[a]; ++n) {
      // Both corners lie in the domain, but their difference may not fit when the depths are far apart.
      std::int64_t const c = tile.tijk()[a] + std::int64_t(box.low[a] + n) * tile.voxelDataWidth();
      flat[a][n] = stride * static_cast<int>((c - coarse.tijk()[a]) / coarse.voxelDataWidth());
    }
  }
  m_source.ops->kernels->gather({at(target, box.target), m_table.targetWidth,
                                 at(source, m_table.sourceOrigin), flat[0], flat[1], flat[2], box.count});
}

template <class TraitsT>
void HaloDriver<TraitsT>::sample(HaloBox const& box, TileType const& tile, TreeIndex const& there,
                                 void* target, float scale, HaloSampler<TraitsT>& sampler) {
  int const s = tile.voxelDataWidth(), w = m_table.targetWidth;
  int3 const first{tile.ti() + s * box.low[0], tile.tj() + s * box.low[1], tile.tk() + s * box.low[2]};
  std::array<int, 3> sides;
  for (std::size_t a = 0; a < 3; ++a)
    sides[a] = box.low[a] < 0 ? -1 : box.low[a] >= m_table.tileDataWidth ? 1 : 0;
  TileType const* const from = solelyCovered(tile, there);
  if (from && sampler.sampleBox(*from, {first, s, box.count, sides, at(target, box.target), w}, scale))
    return;
  for (int k = 0; k < box.count[2]; ++k)
    for (int j = 0; j < box.count[1]; ++j)
      for (int i = 0; i < box.count[0]; ++i)
        sampler.sample(int3{first.x + s * i, first.y + s * j, first.z + s * k}, scale,
                       at(target, box.target + i + (j + k * w) * w));
}

template <class TraitsT>
auto HaloDriver<TraitsT>::solelyCovered(TileType const& tile, TreeIndex const& there) -> TileType const* {
  if (!there.valid() || there.depth >= tile.depth()) return nullptr;
  auto const& tree = *m_accessor.container();
  if (m_deepestRoot == kUnknownDepth)
    for (m_deepestRoot = TraitsT::kMaxDepth; m_deepestRoot >= 0; --m_deepestRoot)
      if (tree.rootCount(m_deepestRoot) > 0) break;
  if (m_deepestRoot > there.depth) return nullptr;
  TileType const* from = &m_accessor.tile(there);
  while (from->depth() > m_source.maxDepth) {
    if (from->isRoot()) return nullptr;
    from = &m_accessor.tile(from->parentTreeIndex());
  }
  return from;
}

template <class TraitsT> void HaloDriver<TraitsT>::copyWholeTile(void* target, Around const& around) const {
  auto const& kernels = *m_source.ops->kernels;
  (TraitsT::kTDW == 4 ? kernels.tile4 : kernels.tile5)[m_table.kind](
      {target, m_table.sourceWidth, m_table.offsets.data(), around.elements});
}

template <class TraitsT> void HaloDriver<TraitsT>::fill(HaloTarget<TraitsT> const& target, HaloMode mode) {
  TileType const& tile = target.tile;
  auto const fillCore = [&](void const* own) {
    if (own)
      copy(m_table.core, target.elements, own);
    else
      set(m_table.core, target.elements, m_source.defaultValue);
  };
  if (m_table.regionCount == 0) return fillCore(m_source.elements(tile.treeIndex()));

  setTile(tile);
  Around const around = elementsAround(tile);
  if (around.own && m_table.kind != kHaloTileOther) {
    copyWholeTile(target.elements, around);
  } else {
    fillCore(around.ownElements());
    for (std::uint64_t there = m_table.around & ~around.missing; there; there &= there - 1) {
      HaloRegion const& region = regionOf(there);
      copy(region, target.elements, around.elements[region.around]);
    }
  }
  if (!around.missing) return;

  if (void const* const parent = target.parentData()) return blend(around.missing, target.elements, parent);
  for (std::uint64_t missing = around.missing; missing; missing &= missing - 1) {
    HaloRegion const& region = regionOf(missing);
    if (mode == kHaloModeReplicate)
      replicate(region, target.elements);
    else
      set(region, target.elements, m_source.defaultValue);
  }
}

template <class TraitsT>
void HaloDriver<TraitsT>::fillRegion(HaloRegion const& region, TileType const& tile, void* target,
                                     HaloFill const& fill, HaloSampler<TraitsT>& sampler) {
  TreeIndex const there = neighbor(tile, region);
  if (void const* const source = neighborElements(tile, there)) return copy(region, target, source);
  if (!there.valid() || there.depth < m_source.minDepth || fill.mode == kHaloModeDefault)
    return set(region, target, m_source.defaultValue);
  switch (fill.mode) {
  case kHaloModeDeepOnly:
    if (there.depth > m_source.maxDepth) sample(region, tile, there, target, fill.scale, sampler);
    return;
  case kHaloModeReplicate:
    return replicate(region, target);
  case kHaloModeNearestCoarse: {
    void const* elements = nullptr;
    TileType const* const coarse = ancestorWithData(&m_accessor.tile(there), elements);
    if (coarse) return nearest(region, tile, target, *coarse, elements);
    return set(region, target, m_source.defaultValue);
  }
  case kHaloModeLinearCoarse:
    return sample(region, tile, there, target, fill.scale, sampler);
  case kHaloModeConstant: {
    alignas(16) std::byte value[kLargestElement];
    m_source.ops->broadcast(fill.constant, value);
    return set(region, target, value);
  }
  default:
    return;
  }
}

template <class TraitsT>
void HaloDriver<TraitsT>::fill(TileType const& tile, void* target, HaloFill const& fill,
                               HaloSampler<TraitsT>& sampler) {
  if (!isHaloMode(fill.mode)) return;
  setTile(tile);
  if (fill.type == kHaloAll && fill.mode != kHaloModeDeepOnly && m_table.kind != kHaloTileOther) {
    // Every region is written, so what has no tile beside may hold other bytes for a moment.
    Around const around = elementsAround(tile);
    if (around.own) {
      copyWholeTile(target, around);
      for (std::uint64_t missing = around.missing; missing; missing &= missing - 1)
        fillRegion(regionOf(missing), tile, target, fill, sampler);
      return;
    }
  }
  if (fill.type & kHaloCore) {
    if (tile.depth() > m_source.maxDepth)
      sample(m_table.core, tile, tile.isRoot() ? TreeIndex{} : tile.parentTreeIndex(), target, fill.scale,
             sampler);
    else if (void const* const own = m_source.elements(tile.treeIndex()))
      copy(m_table.core, target, own);
    else
      set(m_table.core, target, m_source.defaultValue);
  }
  for (int n = 0; n < m_table.regionCount; ++n) {
    HaloRegion const& region = m_table.regions[n];
    if (!(fill.type & (region.face ? kHaloFaces : kHaloEdges)) || fill.type & haloSkip(region.direction))
      continue;
    fillRegion(region, tile, target, fill, sampler);
  }
}

namespace {

// One worker of a pass. Each clone has an accessor and a sampler of its own.
template <class TraitsT> class HaloVisitor final : public Visitor<Container<TraitsT>> {
public:
  using TileType = Tile<TraitsT, TraitsT::kTileSize>;

  HaloVisitor(HaloPass const& pass, HaloFill const* fill, Container<TraitsT> const& tree)
      : m_pass(pass)
      , m_fill(fill)
      , m_tree(tree)
      , m_accessor(tree.tileAccessor())
      , m_driver(pass.source, *pass.table, m_accessor)
      , m_sampler(pass.source, pass.table->sourceWidth, pass.table->sourceOrigin,
                  fill ? fill->offsetType : kVoxelOffsetCorner, m_accessor) {
    this->setEndTileOverridden(false);
  }

  HaloVisitor* clone() const override { return new HaloVisitor(m_pass, m_fill, m_tree); }

  using Visitor<Container<TraitsT>>::beginTile;
  void beginTile(TileType const& tile) override {
    void* const target = const_cast<void*>(m_pass.target.elements(tile.treeIndex()));
    if (!target) return;
    m_driver.prepare(tile, m_pass.target);
    m_pass.target.fetch({tile.index() + kTilesAhead, tile.depth()});
    if (m_fill) return m_driver.fill(tile, target, *m_fill, m_sampler);
    HaloTarget<TraitsT> plain{tile, target};
    if (!tile.isRoot() && tile.depth() > m_pass.firstDepth) {
      plain.parent = &m_tree.tile(tile.parentTreeIndex());
      plain.tiles = &m_pass.target;
    }
    m_driver.fill(plain, kHaloModeReplicate);
  }

private:
  static constexpr std::int64_t kTilesAhead = 4; // whose elements are fetched

  HaloPass const& m_pass;
  HaloFill const* m_fill;
  Container<TraitsT> const& m_tree;
  ConstTileAccessorOf<TraitsT> m_accessor;
  HaloDriver<TraitsT> m_driver;
  HaloSampler<TraitsT> m_sampler;
};

template <class TraitsT> void run(HaloPass pass, HaloFill const* fill, Container<TraitsT> const& tree) {
  int const low = std::max({pass.source.minDepth, pass.target.minDepth, 0});
  int const high = std::min({pass.source.maxDepth, pass.target.maxDepth, TraitsT::kMaxDepth});
  pass.firstDepth = pass.firstDepth == -1 ? low : std::max(pass.firstDepth, low);
  pass.lastDepth = pass.lastDepth == -1 ? high : std::min(pass.lastDepth, high);
  if (pass.firstDepth > pass.lastDepth) return;
  HaloVisitor<TraitsT> visitor(pass, fill, tree);
  TraversalRange range;
  range.minDepth = pass.firstDepth, range.maxDepth = pass.lastDepth;
  range.voxelEnd = 0; // tiles alone
  tree.traverse(visitor, kParallelTopDown, range);
}

} // namespace

template <class TraitsT> void runHaloPass(HaloPass const& pass, Container<TraitsT> const& tree) {
  run(pass, nullptr, tree);
}
template <class TraitsT>
void runHaloPass(HaloPass const& pass, HaloFill const& fill, Container<TraitsT> const& tree) {
  run(pass, &fill, tree);
}

#define VLN_INSTANTIATE(TraitsT)                                                                             \
  template class HaloDriver<TraitsT>;                                                                        \
  template void runHaloPass<TraitsT>(HaloPass const&, Container<TraitsT> const&);                            \
  template void runHaloPass<TraitsT>(HaloPass const&, HaloFill const&, Container<TraitsT> const&);
VLN_FOR_EACH_SHAPE(VLN_INSTANTIATE)

} // namespace VLN::TileTree3D::Internal
