// TypedGrid: GridSource for one grid type.
#pragma once

#include "GeometryVolume/core/Parallel.h"
#include "Interop/VdbGridSourceImpl.h"
#include "Interop/VdbRuleCheckImpl.h"
#include "Interop/VdbStateTilesImpl.h"
#include "Interop/VdbStoredGridImpl.h"
#include "Interop/VdbTileMakerImpl.h"
#include "Interop/VdbUnevenBlocksImpl.h"

#include <algorithm>
#include <initializer_list>
#include <utility>

namespace VLN::Interop {

template <class GridT> class TypedGrid final : public GridSource {
public:
  using TreeT = typename GridT::TreeType;
  using Leaf = typename TreeT::LeafNodeType;
  using Value = typename GridT::ValueType;
  using Element = typename ElementOf<Value>::type;
  using ChannelT = TileTree3D::Channel<VdbTraits, Element, 4, 0>;

  TypedGrid(typename GridT::Ptr const& grid, std::shared_ptr<PackedLeaves> packed)
      : m_grid(grid)
      , m_stored{m_grid->tree(), std::move(packed), m_grid->background(), {}, {}, {}} {
    m_stored.leaves.reserve(m_grid->tree().leafCount());
    forEachInOrder(
        m_grid->tree(),
        [&](Leaf& leaf) {
          if (!m_stored.packed) leaf.setTransientData(static_cast<openvdb::Index32>(m_stored.leaves.size()));
          m_stored.leaves.push_back(&leaf);
        },
        [&](Coord const& c, int width, Value const& value, bool active) {
          m_stored.wide.push_back({c, width, value, active});
        });
    bool fits = placesAgree(m_grid->tree());
    for (Leaf const* leaf : m_stored.leaves) fits = fits && fitsTheTree(leaf->origin(), Leaf::DIM);
    for (Wide const& tile : m_stored.wide)
      fits = fits && (!tile.active || fitsTheTree(tile.corner, tile.width));
    if (!fits)
      m_whyNot = "its voxels lie outside " + std::to_string(VdbTraits::kMinTileCoord) + ".." +
                 std::to_string(VdbTraits::kMaxTileCoord) + " or off the lattice of its nodes";
    // The others are of no use: they neither count nor blend.
    std::erase_if(m_stored.wide, [](Wide const& tile) { return !fitsTheTree(tile.corner, tile.width); });
    if (fits) lookThrough();
  }

  openvdb::GridBase const& grid() const override { return *m_grid; }
  std::string type() const override { return m_grid->valueType(); }
  std::size_t bytesPerSample() const override { return sizeof(Element); }
  std::optional<std::string> whyNotPlaced() const override { return m_whyNot; }
  GridSummary summarize() const override { return m_summary; }
  VdbActiveRule activeRule() const override { return m_rule; }
  std::vector<int3> const& alsoActive() const override { return m_alsoActive; }

  void collectStored(std::vector<int3>& leaves, std::vector<int3>& tiles) const override {
    leaves.reserve(leaves.size() + m_stored.leaves.size());
    for (Leaf const* leaf : m_stored.leaves) leaves.push_back(toInt3(leaf->origin()));
    for (Wide const& tile : m_stored.wide)
      if (!sameBits(tile.value, m_stored.background)) tiles.push_back(toInt3(tile.corner));
  }

  NeededTiles collectTiles(int rootDepth, std::uint64_t mostTiles) const override {
    NeededTiles needed;
    auto add = [&](int depth, int3 const& corner) {
      auto& list = needed.wider[depth];
      if (list.empty() || list.back() != corner) list.push_back(corner);
    };
    constexpr int kWidestDepth = depthOfSamples(kNodeWidths[2]);
    bool const leavesHaveTile = rootDepth < VdbTraits::kMaxDepth;

    UnevenBlocks<TreeT> const uneven(m_stored);
    BlockList before;
    uneven.collectInLeaves(leavesHaveTile, needed.blocks, before);
    for (Wide const& tile : m_stored.wide) {
      int const depth = depthOfSamples(tile.width);
      int3 const c = toInt3(tile.corner);
      if (tile.active) add(depth, alignTo(c, depth));
      if (sameBits(tile.value, m_stored.background)) continue;
      // A root over the tile: what has no finer tile is read there.
      add(rootDepth, alignTo(c, rootDepth));
      // And no sample that is wider than any tile of the file: the way back has no place for it.
      if (rootDepth < kWidestDepth) add(kWidestDepth, alignTo(c, kWidestDepth));
    }
    needed.count = countBlocks(needed.blocks) + countBlocks(before);
    uneven.collectShells(mostTiles, needed.count, before);
    sortPlaces(before);
    needed.blocks = unionOf(needed.blocks, before);
    return needed;
  }

  void collectBeyondRoots(RootPlaces const& roots, std::vector<int3>& out) const override {
    int const width = VdbTraits::width(roots.depth()), step = width / VdbTraits::kTDW;
    Search search(m_grid->tree());
    for (int3 const& root : roots.corners()) {
      unsigned const missing = roots.missingBeside(root);
      if (missing == 0 || isBackground(search, root, width)) continue;
      for (int n = 1; missing >> n != 0; ++n) {
        if (!(missing >> n & 1)) continue;
        int const side[3] = {n & 1, n >> 1 & 1, n >> 2};
        bool inside = true;
        for (int a = 0; a < 3; ++a)
          inside =
              inside && std::int64_t(root[a]) + std::int64_t(side[a]) * width <= VdbTraits::kMaxTileCoord;
        if (inside && goesOn(search, root, side, step))
          out.push_back({root.x + side[0] * width, root.y + side[1] * width, root.z + side[2] * width});
      }
    }
  }

  Ostil::Ptr<TileTree3D::ChannelBase> makeChannel(std::string const& name, TreeToFill const& tree,
                                                  FilledTiles filled) const override {
    VdbContainer const& container = tree.container;
    Element const background = toElement(m_stored.background);
    auto channel = makeEmptyOn<ChannelT>(name, background, tree.topology);
    auto tiles = channel->tileDataAccessor();
    ZeroTiles<Element> zeros(ChannelT::kSize);
    constexpr std::int64_t kPart = 1 << 16;
    std::int64_t untold = 0;
    auto const fill = [&](int depth, std::int64_t first, std::int64_t last) {
      parallelFor(first, last,
                  [&](std::int64_t begin, std::int64_t end) {
                    TileMaker<TreeT, ChannelT> make(m_stored, *channel, zeros);
                    TileVector<Element>* const made = tiles.tileData({0, depth}).data();
                    for (std::int64_t n = begin; n < end; ++n)
                      make(container.tile(n, depth).tijk(), depth, made[n]);
                  },
                  {.grain = 256});
      untold += last - first;
      if (untold >= kPart) filled(std::exchange(untold, 0));
    };
    if (m_stored.packed && tree.followsLeaves) {
      fillAlongLeaves(container, fill);
    } else {
      for (int depth = 0; depth <= VdbTraits::kMaxDepth; ++depth)
        for (std::int64_t first = 0; first < container.tileCount(depth); first += kPart)
          fill(depth, first, std::min(first + kPart, container.tileCount(depth)));
    }
    filled(untold);
    if (m_stored.packed) m_stored.packed->drop(m_stored.leaves.size() * Leaf::SIZE * sizeof(Value));
    zeros.leaveTo(*channel->cloneData());
    return channel;
  }

  Ostil::Ptr<StateChannel> makeStateChannel(std::string const& name, TreeToFill const& tree) const override {
    VdbContainer const& container = tree.container;
    auto channel = makeEmptyOn<StateChannel>(name, static_cast<unsigned char>(0), tree.topology);
    auto tiles = channel->tileDataAccessor();
    ZeroTiles<unsigned char> zeros(StateChannel::kSize);
    for (int depth = 0; depth <= VdbTraits::kMaxDepth; ++depth)
      parallelFor(0, container.tileCount(depth),
                  [&](std::int64_t begin, std::int64_t end) {
                    StateMaker<TreeT> make(m_grid->tree(), *channel, zeros);
                    TileVector<unsigned char>* const made = tiles.tileData({0, depth}).data();
                    for (std::int64_t n = begin; n < end; ++n)
                      make(container.tile(n, depth).tijk(), depth, made[n]);
                  },
                  {.grain = 256});
    zeros.leaveTo(*channel->cloneData());
    return channel;
  }

private:
  using Search = PlaceSearch<TreeT>;
  using Wide = WideTile<Value>;

  /// Whether a tile is known to hold nothing but the background, without its samples.
  bool isBackground(Search& search, int3 const& corner, int width) const {
    IndexBox const& stored = m_summary.stored;
    for (int a = 0; a < 3; ++a)
      if (corner[a] >= stored.max[a] || std::int64_t(corner[a]) + width <= stored.min[a]) return true;
    if (width > kLeafWidth) return false;
    auto const place = search.at(toCoord(leafPlaceOf(corner)));
    if (!place.leaf) return sameBits(place.value, m_stored.background);
    auto const& digest = m_stored.digestOf(*place.leaf);
    return width == kBlockWidth && digest.holds(blockNumber(corner), 0, m_stored.background);
  }
  /// Whether one of a root's outermost samples on some high sides is not the background: without a root
  /// there, it would go on for ever.
  bool goesOn(Search& search, int3 const& root, int const (&side)[3], int step) const {
    for (int k = side[2] ? 3 : 0; k < 4; ++k)
      for (int j = side[1] ? 3 : 0; j < 4; ++j)
        for (int i = side[0] ? 3 : 0; i < 4; ++i)
          if (!sameBits(m_stored.valueAt(search, toCoord(root).offsetBy(i * step, j * step, k * step)),
                        m_stored.background))
            return true;
    return false;
  }

  /// What a look at every voxel tells.
  struct Findings {
    GridSummary summary;
    ValueRange range;
    RuleCheck<TreeT> byBackground, byBand;

    explicit Findings(std::size_t mostAlso)
        : byBackground(VdbActiveRule::kNotBackground, mostAlso)
        , byBand(VdbActiveRule::kInsideBand, mostAlso) {}
  };

  /// Goes through all voxels once: summary, rule and digests.
  void lookThrough() {
    m_stored.digests.resize(m_stored.leaves.size());
    // A place takes 12 bytes, and the states of a leaf up to a hundred times that.
    Findings const nothing(m_stored.leaves.size());
    Findings found = parallelReduce(
        0, std::int64_t(m_stored.leaves.size()), 64, nothing,
        [&](std::int64_t begin, std::int64_t end) {
          Findings part = nothing;
          for (std::int64_t n = begin; n < end; ++n) {
            if (n + 1 < end)
              m_stored.fetch(m_stored.valuesOf(*m_stored.leaves[static_cast<std::size_t>(n) + 1]));
            lookAt(static_cast<std::size_t>(n), part);
          }
          return part;
        },
        [](Findings a, Findings const& b) {
          a.summary = joinSummaries(a.summary, b.summary);
          a.range.join(b.range);
          a.byBackground.join(b.byBackground);
          a.byBand.join(b.byBand);
          return a;
        });
    m_summary = found.summary;
    for (Wide const& tile : m_stored.wide) {
      growBy(m_summary.stored, tile.corner, tile.width);
      int const depth = tile.active ? depthOfSamples(tile.width) : depthOfTiles(tile.width);
      m_summary.shallowest = std::min(m_summary.shallowest, depth);
      found.byBackground.look(tile, m_stored.background);
      found.byBand.look(tile, m_stored.background);
      if (!tile.active) continue;
      growBy(m_summary.active, tile.corner, tile.width);
      m_summary.activeVoxels += std::int64_t(tile.width) * tile.width * tile.width;
      ++m_summary.activeTiles;
      found.range.grow(magnitude(tile.value));
    }
    m_summary.hasRange = !found.range.empty();
    if (m_summary.hasRange) m_summary.minimum = found.range.minimum, m_summary.maximum = found.range.maximum;
    chooseRule({&found.byBackground, &found.byBand});
  }
  /// The first rule that holds without exceptions, else the first one that holds.
  void chooseRule(std::initializer_list<RuleCheck<TreeT> const*> checks) {
    RuleCheck<TreeT> const* chosen = nullptr;
    for (auto const* check : checks) {
      if (!check->holds()) continue;
      if (!chosen || (check->alsoActive().empty() && !chosen->alsoActive().empty())) chosen = check;
    }
    if (chosen) m_rule = chosen->rule(), m_alsoActive = chosen->alsoActive();
  }

  void lookAt(std::size_t n, Findings& found) {
    Leaf const& leaf = *m_stored.leaves[n];
    LeafValues<Leaf> const values(leaf, m_stored.valuesOf(leaf));
    m_stored.digests[leaf.transientData()] = digestOf(values.data());
    growBy(found.summary.stored, leaf.origin(), Leaf::DIM);
    found.summary.activeVoxels += std::int64_t(leaf.onVoxelCount());
    if (IndexBox const box = activeBox(leaf); !box.empty())
      found.summary.active.grow(box.min), found.summary.active.grow(box.max);
    found.range.join(activeRange(leaf, values));
    found.byBackground.look(leaf, values.data(), m_stored.background);
    found.byBand.look(leaf, values.data(), m_stored.background);
  }

  /// Calls `fill(depth, first, last)` for the tiles of all depths, along the leaves, whose voxels go as soon
  /// as they have been read for the last time.
  template <class Fill> void fillAlongLeaves(VdbContainer const& container, Fill const& fill) const {
    constexpr std::int64_t kPiece = 1 << 13;
    constexpr int kMaxDepth = VdbTraits::kMaxDepth;
    std::vector<Leaf const*> const leaves = leavesByNumber();
    PerDepth<std::int64_t, VdbTraits::kDepths> next{};
    for (bool more = true; more;) {
      std::int64_t const last = std::min(next[kMaxDepth] + kPiece, container.tileCount(kMaxDepth));
      more = last < container.tileCount(kMaxDepth);
      int3 const place = more ? leafPlaceOf(container.tile(last, kMaxDepth).tijk()) : int3();
      for (int depth = kMaxDepth; depth >= 0; --depth) {
        std::int64_t end = last;
        if (depth < kMaxDepth) {
          // Of the tiles that begin before the next leaf: each reads nothing in front of its corner.
          end = more ? next[depth] : container.tileCount(depth);
          while (end < container.tileCount(depth) &&
                 comesBefore<LeadingAxis::kZ>(container.tile(end, depth).tijk(), place))
            ++end;
        }
        if (end > next[depth]) fill(depth, next[depth], end);
        next[depth] = end;
      }
      if (more) m_stored.packed->drop(leavesBefore(leaves, place) * Leaf::SIZE * sizeof(Value));
    }
  }

  std::vector<Leaf const*> leavesByNumber() const {
    std::vector<Leaf const*> leaves(m_stored.leaves.size());
    for (Leaf const* leaf : m_stored.leaves) leaves[leaf->transientData()] = leaf;
    return leaves;
  }
  /// How many packed leaves lie before a place.
  static std::size_t leavesBefore(std::vector<Leaf const*> const& packed, int3 const& place) {
    auto const found = std::partition_point(packed.begin(), packed.end(), [&](Leaf const* leaf) {
      return comesBefore<LeadingAxis::kZ>(toInt3(leaf->origin()), place);
    });
    return static_cast<std::size_t>(found - packed.begin());
  }

  /// A channel whose tiles have no samples yet: memory that is written for the first time is best written
  /// once.
  template <class C, class T>
  static Ostil::Ptr<C> makeEmptyOn(std::string const& name, T const& value, VdbTopology const& topology) {
    auto channel =
        Ostil::makePtr<C>(name, &value, TileTree3D::kInitializeNone, false, true, 0, VdbTraits::kMaxDepth);
    channel->setTargetName(topology.name());
    channel->setOwner(topology.getTargetName());
    channel->enableAllocateEmptyTileData();
    channel->update(topology);
    channel->disableAllocateEmptyTileData();
    return channel;
  }
  typename GridT::ConstPtr m_grid;
  StoredGrid<TreeT> m_stored;
  std::optional<std::string> m_whyNot;
  GridSummary m_summary;
  VdbActiveRule m_rule = VdbActiveRule::kChannel;
  std::vector<int3> m_alsoActive;
};

/// Source of the one type among `Grids` that fits.
template <class... Grids> std::unique_ptr<GridSource> sourceAmong(GridToRead const& from) {
  std::unique_ptr<GridSource> source;
  auto const attempt = [&]<class GridT>(GridT const*) {
    if (source) return;
    if (auto typed = openvdb::gridPtrCast<GridT>(from.grid))
      source = std::make_unique<TypedGrid<GridT>>(typed, from.packed);
  };
  (attempt(static_cast<Grids const*>(nullptr)), ...);
  return source;
}

} // namespace VLN::Interop
