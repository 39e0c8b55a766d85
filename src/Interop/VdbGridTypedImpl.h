// TypedGrid: GridSource for one grid type.
#pragma once

#include "GeometryVolume/core/Parallel.h"
#include "Interop/VdbGridSourceImpl.h"
#include "Interop/VdbLeafPlacesImpl.h"
#include "Interop/VdbStateTilesImpl.h"
#include "Interop/VdbTilesRoundImpl.h"
#include "Interop/VdbZeroTilesImpl.h"

#include <algorithm>

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
      , m_packed(std::move(packed))
      , m_background(m_grid->background()) {
    m_leaves.reserve(m_grid->tree().leafCount());
    forEachInOrder(
        m_grid->tree(),
        [&](Leaf& leaf) {
          if (!m_packed) leaf.setTransientData(static_cast<openvdb::Index32>(m_leaves.size()));
          m_leaves.push_back(&leaf);
        },
        [&](Coord const& c, int width, Value const& value, bool active) {
          m_wide.push_back({c, width, value, active});
        });
    bool fits = placesAgree(m_grid->tree());
    for (Leaf const* leaf : m_leaves) fits = fits && fitsTheTree(leaf->origin(), Leaf::DIM);
    for (WideTile const& tile : m_wide) fits = fits && (!tile.active || fitsTheTree(tile.corner, tile.width));
    if (!fits)
      m_whyNot = "its voxels lie outside " + std::to_string(VdbTraits::kMinTileCoord) + ".." +
                 std::to_string(VdbTraits::kMaxTileCoord) + " or off the lattice of its nodes";
    // The others are of no use: they neither count nor blend.
    std::erase_if(m_wide, [](WideTile const& tile) { return !fitsTheTree(tile.corner, tile.width); });
    if (fits) lookThrough();
  }

  openvdb::GridBase const& grid() const override { return *m_grid; }
  std::string type() const override { return m_grid->valueType(); }
  std::size_t bytesPerSample() const override { return sizeof(Element); }
  std::optional<std::string> whyNotPlaced() const override { return m_whyNot; }
  GridSummary summarize() const override { return m_summary; }
  VdbActiveRule activeRule() const override { return m_rule; }

  void collectStored(std::vector<int3>& leaves, std::vector<int3>& tiles) const override {
    for (Leaf const* leaf : m_leaves) leaves.push_back(toInt3(leaf->origin()));
    for (WideTile const& tile : m_wide)
      if (!sameBits(tile.value, m_background)) tiles.push_back(toInt3(tile.corner));
  }

  NeededTiles collectTiles(int rootDepth, std::uint64_t mostTiles) const override {
    NeededTiles needed;
    auto add = [&](int depth, int3 const& corner) {
      auto& list = needed.wider[depth];
      if (list.empty() || list.back() != corner) list.push_back(corner);
    };
    constexpr int kWidestDepth = depthOfSamples(kNodeWidths[2]);
    bool const leavesHaveTile = rootDepth < VdbTraits::kMaxDepth;

    // In the leaves, which are in order, and before them: only what lies before is out of order.
    BlockList before;
    collectInParallel(
        std::int64_t(m_leaves.size()), 256,
        [&](std::int64_t n, Search& search, BlockList& own, BlockList& places) {
          Leaf const& leaf = *m_leaves[static_cast<std::size_t>(n)];
          auto const& digest = m_digests[leaf.transientData()];
          Places round = placesRound(search, leaf.origin());
          unsigned blocks = activeBlocks(leaf);
          for (int b = 0; b < 8; ++b) {
            if (blocks >> b & 1) continue;
            int const x = b >> 2, y = b >> 1 & 1, z = b & 1;
            bool const spare = (digest.uniform >> 8 * b & 1) && round.isUniform(x, y, z) &&
                               (leavesHaveTile || sameBits(round.valueAt(x, y, z), m_background));
            if (!spare) blocks |= 1u << b;
          }
          if (blocks != 0 || leavesHaveTile) own.push_back({toInt3(leaf.origin()), blocks});
          collectBeforeLeaf(round, leaf.origin(), places);
        },
        needed.blocks, before);

    for (WideTile const& tile : m_wide) {
      int const depth = depthOfSamples(tile.width);
      int3 const c = toInt3(tile.corner);
      if (tile.active) add(depth, alignTo(c, depth));
      if (sameBits(tile.value, m_background)) continue;
      // A root over the tile: what has no finer tile is read there.
      add(rootDepth, alignTo(c, rootDepth));
      // And no sample that is wider than any tile of the file: the way back has no place for it.
      if (rootDepth < kWidestDepth) add(kWidestDepth, alignTo(c, kWidestDepth));
    }
    needed.count = countBlocks(needed.blocks) + countBlocks(before);
    collectShells(mostTiles, needed.count, before);
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
    Element const background = toElement(m_background);
    auto channel = makeEmptyOn<ChannelT>(name, background, tree.topology);
    auto tiles = channel->tileDataAccessor();
    ZeroTiles<Element> zeros(ChannelT::kSize);
    constexpr std::int64_t kPart = 1 << 16, kPiece = 1 << 14;
    // The deepest tiles come last, and read the voxels leaf by leaf.
    std::vector<Leaf const*> const packed =
        m_packed && tree.followsLeaves ? leavesByNumber() : std::vector<Leaf const*>();
    for (int depth = 0; depth <= VdbTraits::kMaxDepth; ++depth) {
      std::int64_t const count = container.tileCount(depth);
      for (std::int64_t first = 0, told = 0; first < count; first += kPiece) {
        std::int64_t const last = std::min(first + kPiece, count);
        parallelFor(first, last,
                    [&](std::int64_t begin, std::int64_t end) {
                      TileMaker make(*this, *channel, zeros);
                      TileVector<Element>* const made = tiles.tileData({0, depth}).data();
                      for (std::int64_t n = begin; n < end; ++n)
                        make(container.tile(n, depth).tijk(), depth, made[n]);
                    },
                    {.grain = 256});
        if (!packed.empty() && depth == VdbTraits::kMaxDepth && last < count)
          m_packed->drop(leavesBefore(packed, container.tile(last, depth).tijk()) * Leaf::SIZE *
                         sizeof(Value));
        if (last - told < kPart && last < count) continue;
        filled(last - told);
        told = last;
      }
    }
    if (m_packed) m_packed->drop(m_leaves.size() * Leaf::SIZE * sizeof(Value));
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
  using Places = LeafPlaces<TreeT>;

  /// Whether a tile is known to hold nothing but the background, without its samples.
  bool isBackground(Search& search, int3 const& corner, int width) const {
    IndexBox const& stored = m_summary.stored;
    for (int a = 0; a < 3; ++a)
      if (corner[a] >= stored.max[a] || std::int64_t(corner[a]) + width <= stored.min[a]) return true;
    if (width > kLeafWidth) return false;
    auto const place = search.at(toCoord(leafPlaceOf(corner)));
    if (!place.leaf) return sameBits(place.value, m_background);
    auto const& digest = m_digests[place.leaf->transientData()];
    return width == kBlockWidth && digest.holds(blockNumber(corner), 0, m_background);
  }
  /// Of the block in its leaf.
  static int blockNumber(int3 const& corner) {
    return (corner.x & 4) | (corner.y & 4) >> 1 | (corner.z & 4) >> 2;
  }

  /// Whether one of a root's outermost samples on some high sides is not the background: without a root
  /// there, it would go on for ever.
  bool goesOn(Search& search, int3 const& root, int const (&side)[3], int step) const {
    for (int k = side[2] ? 3 : 0; k < 4; ++k)
      for (int j = side[1] ? 3 : 0; j < 4; ++j)
        for (int i = side[0] ? 3 : 0; i < 4; ++i)
          if (!sameBits(valueAt(search, toCoord(root).offsetBy(i * step, j * step, k * step)), m_background))
            return true;
    return false;
  }

  /// The voxels of a leaf, unless they are bits.
  Value const* valuesOf(Leaf const& leaf) const {
    if constexpr (std::is_same_v<Value, bool>)
      return nullptr;
    else if (m_packed)
      return static_cast<Value const*>(m_packed->begin()) + std::size_t(leaf.transientData()) * Leaf::SIZE;
    else
      return leaf.buffer().data();
  }
  /// Has the voxels of a leaf fetched: leaves are small, and mostly over before the processor sees a pattern.
  static void fetchAhead(Value const* values) {
    if constexpr (!std::is_same_v<Value, bool>)
      for (std::size_t byte = 0; byte < Leaf::SIZE * sizeof(Value); byte += 64)
        __builtin_prefetch(reinterpret_cast<char const*>(values) + byte);
  }
  Value valueAt(Search& search, Coord const& c) const {
    auto const place = search.at(c);
    if (!place.leaf) return place.value;
    auto const n = Leaf::coordToOffset(c);
    if constexpr (std::is_same_v<Value, bool>)
      return place.leaf->getValue(n);
    else
      return valuesOf(*place.leaf)[n];
  }
  Places placesRound(Search& search, Coord const& corner) const {
    return Places(search, m_digests.data(), corner);
  }

  /// A tile of the file's tree that is active, or has another value than the background.
  struct WideTile {
    Coord corner;
    int width;
    Value value;
    bool active;
  };

  /// What a look at every voxel tells.
  struct Findings {
    GridSummary summary;
    ValueRange range;
    bool byBackground = true, byBand = true; ///< whether the rule holds for every voxel
  };

  /// Goes through all voxels once: summary, rule and digests.
  void lookThrough() {
    m_digests.resize(m_leaves.size());
    Findings found = parallelReduce(
        0, std::int64_t(m_leaves.size()), 64, Findings{},
        [&](std::int64_t begin, std::int64_t end) {
          Findings part;
          for (std::int64_t n = begin; n < end; ++n) {
            if (n + 1 < end) fetchAhead(valuesOf(*m_leaves[static_cast<std::size_t>(n) + 1]));
            lookAt(static_cast<std::size_t>(n), part);
          }
          return part;
        },
        [](Findings a, Findings const& b) {
          a.summary = joinSummaries(a.summary, b.summary);
          a.range.join(b.range);
          a.byBackground = a.byBackground && b.byBackground;
          a.byBand = a.byBand && b.byBand;
          return a;
        });
    m_summary = found.summary;
    for (WideTile const& tile : m_wide) {
      growBy(m_summary.stored, tile.corner, tile.width);
      int const depth = tile.active ? depthOfSamples(tile.width) : depthOfTiles(tile.width);
      m_summary.shallowest = std::min(m_summary.shallowest, depth);
      found.byBackground = found.byBackground && !tile.active &&
                           !followsRule<Value>(VdbActiveRule::kNotBackground, tile.value, m_background);
      found.byBand = found.byBand && !tile.active &&
                     !followsRule<Value>(VdbActiveRule::kInsideBand, tile.value, m_background);
      if (!tile.active) continue;
      growBy(m_summary.active, tile.corner, tile.width);
      m_summary.activeVoxels += std::int64_t(tile.width) * tile.width * tile.width;
      ++m_summary.activeTiles;
      found.range.grow(magnitude(tile.value));
    }
    m_summary.hasRange = !found.range.empty();
    if (m_summary.hasRange) m_summary.minimum = found.range.minimum, m_summary.maximum = found.range.maximum;
    m_rule = found.byBackground ? VdbActiveRule::kNotBackground
             : found.byBand     ? VdbActiveRule::kInsideBand
                                : VdbActiveRule::kChannel;
  }

  void lookAt(std::size_t n, Findings& found) {
    Leaf const& leaf = *m_leaves[n];
    LeafValues<Leaf> const values(leaf, valuesOf(leaf));
    m_digests[leaf.transientData()] = digestOf(values.data());
    growBy(found.summary.stored, leaf.origin(), Leaf::DIM);
    found.summary.activeVoxels += std::int64_t(leaf.onVoxelCount());
    if (IndexBox const box = activeBox(leaf); !box.empty())
      found.summary.active.grow(box.min), found.summary.active.grow(box.max);
    found.range.join(activeRange(leaf, values));
    auto const holds = [&](VdbActiveRule rule) {
      for (int i = 0; i < kLeafWidth; ++i)
        if (wordByRule<Value>(rule, values.data() + 64 * i, m_background) != maskWord(leaf, i)) return false;
      return true;
    };
    found.byBackground = found.byBackground && holds(VdbActiveRule::kNotBackground);
    found.byBand = found.byBand && holds(VdbActiveRule::kInsideBand);
  }

  /// Appends what `collect(n, accessor, part...)` finds for each n to each of the lists, in order.
  template <class Collect, class... Lists>
  void collectInParallel(std::int64_t count, std::int64_t grain, Collect const& collect,
                         Lists&... lists) const {
    using Part = std::array<BlockList, sizeof...(Lists)>;
    std::vector<Part> parts(static_cast<std::size_t>(chunkCount(0, count, grain)));
    parallelChunks(0, count, grain, [&](std::int64_t chunk, std::int64_t begin, std::int64_t end) {
      Search search(m_grid->tree());
      Part& part = parts[static_cast<std::size_t>(chunk)];
      for (std::int64_t n = begin; n < end; ++n)
        std::apply([&](auto&... list) { collect(n, search, list...); }, part);
    });
    std::size_t n = 0;
    auto const append = [&](BlockList& list) {
      std::size_t size = list.size();
      for (Part const& part : parts) size += part[n].size();
      list.reserve(size);
      for (Part const& part : parts) list.insert(list.end(), part[n].begin(), part[n].end());
      ++n;
    };
    (append(lists), ...);
  }
  /// A block of the place that lies x, y, z blocks from another one's first.
  static int3 blockOf(int3 const& place, int x, int y, int z) {
    return {place.x + kBlockWidth * x, place.y + kBlockWidth * y, place.z + kBlockWidth * z};
  }
  /// The first of all blocks of a place.
  static int3 placeOf(Coord const& leaf, int x, int y, int z) {
    return {leaf.x() + kLeafWidth * x, leaf.y() + kLeafWidth * y, leaf.z() + kLeafWidth * z};
  }

  /// Appends those of a place's blocks whose blends give more than one value.
  /// @param blocks Bits, numbered as in PlaceBlocks.
  /// @param x, y, z The place, counted from that which `places` lie round.
  static void collectUnlessUniform(Places& places, Coord const& origin, int x, int y, int z, unsigned blocks,
                                   BlockList& out) {
    int3 const place = placeOf(origin, x, y, z);
    unsigned found = 0;
    for (int n = 0; n < 8; ++n) {
      if (!(blocks >> n & 1)) continue;
      int const bx = n >> 2, by = n >> 1 & 1, bz = n & 1;
      if (VdbTraits::inDomain(blockOf(place, bx, by, bz)) &&
          !places.isUniform(2 * x + bx, 2 * y + by, 2 * z + bz))
        found |= 1u << n;
    }
    if (found == 0) return;
    if (!out.empty() && out.back().place == place)
      out.back().blocks |= found;
    else
      out.push_back({place, found});
  }

  /// The blocks before a leaf's low sides, as far as no leaf holds them.
  static void collectBeforeLeaf(Places& places, Coord const& origin, BlockList& out) {
    // Of a place before on some axes those that touch the leaf: on these axes the second ones.
    constexpr unsigned kSecond[3] = {0xF0, 0xCC, 0xAA};
    for (int n = 1; n < 8; ++n) {
      int const x = n & 1, y = n >> 1 & 1, z = n >> 2;
      if (places.at(-x, -y, -z).digest) continue;
      unsigned const touching =
          (x ? kSecond[0] : 0xFFu) & (y ? kSecond[1] : 0xFFu) & (z ? kSecond[2] : 0xFFu);
      collectUnlessUniform(places, origin, -x, -y, -z, touching, out);
    }
  }

  /// The blocks at the surfaces of wide tiles: those inside at the high sides, and those before the low ones.
  /// Inside such a block a value goes over to another one within one voxel.
  /// @param planned Tiles that there are already. Grows by those that are looked at.
  void collectShells(std::uint64_t mostTiles, std::uint64_t& planned, BlockList& out) const {
    for (int const width : kNodeWidths) {
      std::vector<WideTile const*> exposed = exposedTiles(width);
      // A shell grows with the square of the width: where memory ends, the widest tiles stay coarse.
      int const across = width / kBlockWidth;
      planned += std::uint64_t(exposed.size()) * 6 * std::uint64_t(across) * std::uint64_t(across);
      if (planned > mostTiles) return;
      if (width == kLeafWidth) {
        collectInParallel(
            std::int64_t(exposed.size()), 96,
            [&](std::int64_t n, Search& search, BlockList& part) {
              collectRound(search, exposed[static_cast<std::size_t>(n)]->corner, part);
            },
            out);
        continue;
      }
      auto const rows = std::int64_t(across) + 1;
      collectInParallel(
          std::int64_t(exposed.size()) * rows, 1,
          [&](std::int64_t n, Search& search, BlockList& part) {
            collectSlice(search, exposed[static_cast<std::size_t>(n / rows)]->corner, across,
                         static_cast<int>(n % rows) - 1, part);
          },
          out);
    }
  }

  /// The tiles of a width with another value than the background, beside which lies something else.
  std::vector<WideTile const*> exposedTiles(int width) const {
    std::vector<WideTile const*> list;
    for (WideTile const& tile : m_wide)
      if (tile.width == width && !sameBits(tile.value, m_background)) list.push_back(&tile);
    std::vector<char> exposed(list.size());
    std::vector<std::size_t> const runs = runsInNodes(list);
    // The narrow tiles of most grids all have one value: where a node has many, it is looked at whole.
    bool const alike = width == kLeafWidth && list.size() > 8 * runs.size() &&
                       std::all_of(list.begin(), list.end(), [&](WideTile const* tile) {
                         return sameBits(tile->value, list[0]->value);
                       });
    std::optional<TilesRound<TreeT>> round;
    if (alike) round.emplace(m_grid->tree(), list[0]->value);
    parallelFor(0, std::int64_t(runs.size()),
                [&](std::int64_t begin, std::int64_t end) {
                  Search search(m_grid->tree());
                  for (auto run = static_cast<std::size_t>(begin); run < static_cast<std::size_t>(end);
                       ++run) {
                    std::size_t const last = run + 1 < runs.size() ? runs[run + 1] : list.size();
                    if (!alike) {
                      for (std::size_t n = runs[run]; n < last; ++n) exposed[n] = isExposed(search, *list[n]);
                      continue;
                    }
                    auto const inside = round->inside(search, *search.lower(list[runs[run]]->corner));
                    for (std::size_t n = runs[run]; n < last; ++n) {
                      auto const slot = Search::Lower::coordToOffset(list[n]->corner);
                      exposed[n] = !(inside[slot / 64] >> slot % 64 & 1);
                    }
                  }
                },
                {});
    std::size_t kept = 0;
    for (std::size_t n = 0; n < list.size(); ++n)
      if (exposed[n]) list[kept++] = list[n];
    list.resize(kept);
    return list;
  }
  /// Where the tiles of another node begin: those of one lie side by side.
  static std::vector<std::size_t> runsInNodes(std::vector<WideTile const*> const& tiles) {
    std::vector<std::size_t> runs;
    for (std::size_t n = 0; n < tiles.size(); ++n) {
      auto const nodeOf = [](WideTile const* tile) { return tile->corner & -kNodeWidths[1]; };
      if (n == 0 || nodeOf(tiles[n]) != nodeOf(tiles[n - 1])) runs.push_back(n);
    }
    return runs;
  }
  /// Whether one of a tile's 26 neighbours of the same width is finer, or has another value.
  bool isExposed(Search& search, WideTile const& tile) const {
    if (auto const* const lower = search.lower(tile.corner); lower && Search::isInside(*lower, tile.corner))
      return isExposed(*lower, Search::Lower::coordToOffset(tile.corner), tile.value);
    int const level = tile.width == kNodeWidths[0] ? 2 : tile.width == kNodeWidths[1] ? 1 : 0;
    for (int n = 0; n < 27; ++n) {
      Coord const c = tile.corner.offsetBy((n / 9 - 1) * tile.width, (n / 3 % 3 - 1) * tile.width,
                                           (n % 3 - 1) * tile.width);
      auto const place = search.at(c);
      if (place.level > level || !sameBits(place.value, tile.value)) return true;
    }
    return false;
  }

  /// The same of a tile whose neighbours are all in one node.
  static bool isExposed(typename Search::Lower const& lower, openvdb::Index slot, Value const& value) {
    auto const* const table = lower.getTable();
    for (int x = -1; x < 2; ++x)
      for (int y = -1; y < 2; ++y)
        for (int z = -1; z < 2; ++z) {
          openvdb::Index const beside = slot + static_cast<openvdb::Index>(256 * x + 16 * y + z);
          if (lower.isChildMaskOn(beside) || !sameBits(Value(table[beside].getValue()), value)) return true;
        }
    return false;
  }

  /// The blocks in and before a tile that is as wide as a leaf. Those in leaves have been looked at, and
  /// those in tiles like this one come with them.
  void collectRound(Search& search, Coord const& corner, BlockList& out) const {
    Places places = placesRound(search, corner);
    // The first block of the tile blends with nothing else.
    collectUnlessUniform(places, corner, 0, 0, 0, 0xFE, out);
    constexpr unsigned kSecond[3] = {0xF0, 0xCC, 0xAA};
    for (int n = 1; n < 8; ++n) {
      int const x = n & 1, y = n >> 1 & 1, z = n >> 2;
      auto const& place = places.at(-x, -y, -z);
      if (place.digest || (place.isNarrow && !sameBits(place.value, m_background))) continue;
      unsigned const touching =
          (x ? kSecond[0] : 0xFFu) & (y ? kSecond[1] : 0xFFu) & (z ? kSecond[2] : 0xFFu);
      collectUnlessUniform(places, corner, -x, -y, -z, touching, out);
    }
  }
  /// The blocks of the shell of a wider tile with one z, of -1 to across - 1.
  void collectSlice(Search& search, Coord const& corner, int across, int z, BlockList& out) const {
    auto const outer = [&](int c) { return c == -1 || c == across - 1; };
    for (int y = -1; y < across; ++y) {
      int const step = outer(z) || outer(y) ? 1 : across;
      for (int x = -1; x < across; x += step) {
        int3 const place = leafPlaceOf(blockOf(toInt3(corner), x, y, z));
        Places places = placesRound(search, toCoord(place));
        collectUnlessUniform(places, toCoord(place), 0, 0, 0, 1u << (4 * (x & 1) + 2 * (y & 1) + (z & 1)),
                             out);
      }
    }
  }

  std::vector<Leaf const*> leavesByNumber() const {
    std::vector<Leaf const*> leaves(m_leaves.size());
    for (Leaf const* leaf : m_leaves) leaves[leaf->transientData()] = leaf;
    return leaves;
  }
  /// How many packed leaves lie before the place of a tile.
  static std::size_t leavesBefore(std::vector<Leaf const*> const& packed, int3 const& corner) {
    int3 const place = leafPlaceOf(corner);
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
  /// The place of a leaf that was looked up last: tiles that are filled one after another share it.
  struct LastPlace {
    int3 corner{1, 1, 1}; ///< at first none that a place has
    LeafPlace<TreeT> place;
    bool isZero = false;           ///< where there is no leaf
    Value const* values = nullptr; ///< of the leaf, unless they are bits
  };

  /// Makes the tiles of a channel, each thread with one of its own.
  class TileMaker {
  public:
    TileMaker(TypedGrid const& grid, ChannelT const& channel, ZeroTiles<Element>& zeros)
        : m_grid(grid)
        , m_channel(channel)
        , m_zeros(zeros)
        , m_search(grid.m_grid->tree()) {}

    /// @param made Empty.
    void operator()(int3 const& corner, int depth, TileVector<Element>& made) {
      if (VdbTraits::width(depth) <= kLeafWidth) {
        m_grid.lookUp(m_search, m_last, leafPlaceOf(corner));
        auto const& place = m_last.place;
        bool const deepest = depth == VdbTraits::kMaxDepth;
        if (place.leaf ? deepest && m_grid.isZeroBlock(*place.leaf, corner) : m_last.isZero)
          return m_zeros.make(m_run, made);
        if (deepest || !place.leaf) {
          made = m_channel.unwrittenTile();
          if (place.leaf)
            m_grid.fillTile(m_search, m_last, corner, depth, made.data());
          else
            TileTree3D::Internal::fillRun(made.data(), ChannelT::kSize, toElement(place.value));
          return;
        }
      }
      Element samples[ChannelT::kSize];
      m_grid.fillTile(m_search, m_last, corner, depth, samples);
      if (areZeros(samples, ChannelT::kSize)) return m_zeros.make(m_run, made);
      made = m_channel.unwrittenTile();
      std::copy(std::begin(samples), std::end(samples), made.data());
    }

  private:
    TypedGrid const& m_grid;
    ChannelT const& m_channel;
    ZeroTiles<Element>& m_zeros;
    typename ZeroTiles<Element>::Run m_run;
    Search m_search;
    LastPlace m_last;
  };

  /// Whether all bits of the voxels in a block are zero.
  bool isZeroBlock(Leaf const& leaf, int3 const& corner) const {
    auto const& digest = m_digests[leaf.transientData()];
    int const block = blockNumber(corner);
    return (digest.uniform >> 8 * block & 1) && areZeros(&digest.first[block], 1);
  }
  void lookUp(Search& search, LastPlace& last, int3 const& corner) const {
    if (last.corner != corner) lookUpAnew(search, last, corner);
  }
  [[gnu::noinline]] void lookUpAnew(Search& search, LastPlace& last, int3 const& corner) const {
    last.place = search.at(toCoord(corner));
    last.corner = corner;
    if (last.place.leaf)
      last.values = valuesOf(*last.place.leaf);
    else
      last.isZero = areZeros(&last.place.value, 1);
  }

  void fillTile(Search& search, LastPlace& last, int3 const& corner, int depth, Element* samples) const {
    int const step = VdbTraits::width(depth) / VdbTraits::kTDW;
    if (step >= kLeafWidth) {
      for (int k = 0; k < 4; ++k)
        for (int j = 0; j < 4; ++j)
          for (int i = 0; i < 4; ++i)
            *samples++ = toElement(valueAt(search, toCoord(corner).offsetBy(i * step, j * step, k * step)));
      return;
    }
    // Leaf by leaf, or what stands in its place: each holds `count` samples along an axis.
    int const count = std::min(4, kLeafWidth / step);
    for (int k = 0; k < 4; k += count)
      for (int j = 0; j < 4; j += count)
        for (int i = 0; i < 4; i += count)
          fillFromPlace(search, last, toCoord(corner).offsetBy(i * step, j * step, k * step), step, count,
                        samples + i + 4 * (j + 4 * k));
  }
  void fillFromPlace(Search& search, LastPlace& last, Coord const& at, int step, int count,
                     Element* samples) const {
    lookUp(search, last, leafPlaceOf(toInt3(at)));
    Leaf const* const leaf = last.place.leaf;
    auto const fill = [&](auto const& valueAt) {
      for (int k = 0; k < count; ++k)
        for (int j = 0; j < count; ++j)
          for (int i = 0; i < count; ++i)
            samples[i + 4 * (j + 4 * k)] = toElement(Value(valueAt((64 * i + 8 * j + k) * step)));
    };
    if (!leaf) {
      return fill([&](int) { return last.place.value; });
    }
    auto const first = static_cast<int>(Leaf::coordToOffset(at));
    if constexpr (std::is_same_v<Value, bool>) { // kept as bits
      fill([&](int n) { return leaf->getValue(static_cast<openvdb::Index>(first + n)); });
    } else {
      Value const* const values = last.values + first;
      if (step == 1) return copyBlock(values, samples);
      fill([&](int n) { return values[n]; });
    }
  }

  typename GridT::ConstPtr m_grid;
  std::shared_ptr<PackedLeaves> m_packed; ///< null where leaves have buffers
  Value m_background;
  std::vector<Leaf const*> m_leaves;        ///< along the Z-shaped curve
  std::vector<LeafDigest<Value>> m_digests; ///< by the leaves' numbers, their transient data
  std::vector<WideTile> m_wide;             ///< along the Z-shaped curve
  std::optional<std::string> m_whyNot;
  GridSummary m_summary;
  VdbActiveRule m_rule = VdbActiveRule::kChannel;
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
