// HaloTable: the boxes that a halo computation moves, for one pair of tile layouts.
//
//          low halo      tile data of the tree      plane of an extended tile and high halo
//   i:   -H ........ -1 | 0 ................ W-1 | W ............ W+X+H-1      X: 1 when extended, else 0
//
// The centre is the "core", filled from the source's own tile. Each of the 26 boxes round it belongs to a
// direction and reads from the neighbour there, W further on. Boxes without elements are left out, so that a
// target without halo keeps the seven directions without a negative step, and one that is not extended none.
#pragma once

#include "GeometryVolume/channels/ChannelLayouts.h"
#include "GeometryVolume/channels/ChannelTypes.h"
#include "GeometryVolume/channels/HaloKernelsImpl.h"
#include "GeometryVolume/tiletree/TreeIndex.h"

#include <algorithm>
#include <array>
#include <bit>

namespace VLN::TileTree3D::Internal {

using Velorn::Math::int3;

/// A box of a target tile, and where its elements come from in a source tile.
struct HaloBox {
  std::array<int, 3> low{};   ///< first coordinate on each axis
  std::array<int, 3> count{}; ///< elements along each axis
  int target = 0;             ///< flat index of the first element in the target
  int source = 0;             ///< and in the source's tile in that direction
};

struct HaloRegion : HaloBox {
  NeighborDirection direction = kNeighborSelf;
  bool face = false;
  int blockSlot = 0; ///< steps in a block of children with one layer round them, i fastest
  int around = 0;    ///< steps in a PointerBlock
};

/// How the elements of tiles are kept together: by place, i fastest, one pointer for each. With two children
/// along an edge, those of a tile and one layer round them; a block of more would be filled for nothing where
/// few of the children are there, so that else it is a tile and those round it.
template <int TileWidth> struct PointerBlock {
  static constexpr bool kOfParent = TileWidth == 2;
  static constexpr int kAcross = kOfParent ? TileWidth + 2 : 3;
  static constexpr int kSize = kAcross * kAcross * kAcross;
  static constexpr int kFirst = 1 + kAcross * (1 + kAcross); ///< the first child, or the tile
  static_assert(kSize <= 64, "one bit for each place");

  static constexpr int steps(int i, int j, int k) { return i + kAcross * (j + kAcross * k); }
};

/// One axis of a read from the parent: the low one of two samples, and the fraction of the high one.
struct HaloAxis {
  int at = 0;
  float fraction = 0;
};

struct HaloTable {
  static constexpr int kLargestWidth = kLargestChannelTileWidth;
  static constexpr int kLargestTileWidth = std::max(PowerOfTwoTraits::kTW, OddTraits::kTW);

  int tileDataWidth = 0; ///< W
  int halo = 0;          ///< of the target
  HaloTileKind kind = kHaloTileOther;
  int targetWidth = 0, sourceWidth = 0;
  int targetSize = 0, sourceSize = 0;
  int targetOrigin = 0, sourceOrigin = 0; ///< flat index of coordinate (0,0,0)
  HaloBox core;
  std::array<HaloRegion, 26> regions{}; ///< those without a negative step first, beginning with +i, +j, +k
  int regionCount = 0;
  std::uint64_t around = 0; ///< a bit for each region's place in a PointerBlock, the tile's own at kFirst
  std::array<std::uint8_t, 64> regionAt{}; ///< which region such a bit stands for
  /// Regions, as such bits, of a tile of four samples and two children along an edge, by the axes along which
  /// they are as long as the core, where they are one sample wide along all others. A bit for each axis.
  std::array<std::uint64_t, 7> aroundByLength{};
  std::array<int, kNeighborCount>
      offsets{}; ///< by direction: where the core's and the regions' source begins
  /// For a tile that is child c of its parent along an axis: where each coordinate lies in the parent, whose
  /// tile has the target's layout. [c][coordinate + halo]
  std::array<std::array<HaloAxis, kLargestWidth>, kLargestTileWidth> parentAxis{};

  /// The region of the lowest bit of some places.
  HaloRegion const& regionOf(std::uint64_t places) const {
    return regions[regionAt[std::countr_zero(places)]];
  }
};

/// Where coordinate `at` of child `child` lies among the samples of the parent, with samples on low corners.
/// @formula x = (child * W + at) / kTW: the distance of the corners and of the samples in units of the
/// child's samples, divided by the samples' ratio. The floor is limited so that the second sample stays in
/// the tile.
constexpr HaloAxis parentAxisAt(int child, int at, int tileDataWidth, int tileWidth, int largest) {
  int const numerator = child * tileDataWidth + at;
  float const x = static_cast<float>(numerator) / static_cast<float>(tileWidth);
  int low = numerator / tileWidth - (numerator % tileWidth < 0 ? 1 : 0);
  if (low > largest) low = largest;
  return {low, x - static_cast<float>(low)};
}

template <int TileWidth>
constexpr HaloTable makeHaloTable(ChannelLayout const& source, ChannelLayout const& target) {
  constexpr int tileWidth = TileWidth; // children along a tile's edge
  using Block = PointerBlock<TileWidth>;
  HaloTable t;
  int const w = target.tileDataWidth;
  t.tileDataWidth = w;
  t.halo = target.halo;
  if (target.extended + target.halo == 1) t.kind = target.extended ? kHaloTileExtended : kHaloTileHalo1;
  t.targetWidth = target.width(), t.sourceWidth = source.width();
  t.targetSize = target.size, t.sourceSize = source.size;
  t.targetOrigin = target.element(0, 0, 0), t.sourceOrigin = source.element(0, 0, 0);
  t.core = {{0, 0, 0}, {w, w, w}, t.targetOrigin, t.sourceOrigin};
  t.offsets[kNeighborSelf] = t.sourceOrigin;

  auto const add = [&](int3 const& step) {
    HaloRegion r;
    r.direction = neighborDirection(step.x, step.y, step.z);
    int const moved = (step.x != 0) + (step.y != 0) + (step.z != 0);
    r.face = moved == 1;
    r.blockSlot = step.x + (tileWidth + 2) * (step.y + (tileWidth + 2) * step.z);
    int const steps[3] = {step.x, step.y, step.z};
    int targetStride = 1, sourceStride = 1;
    r.target = t.targetOrigin, r.source = t.sourceOrigin;
    for (std::size_t a = 0; a < 3; ++a) {
      r.low[a] = steps[a] < 0 ? -target.halo : steps[a] > 0 ? w : 0;
      r.count[a] = steps[a] < 0 ? target.halo : steps[a] > 0 ? target.extended + target.halo : w;
      if (r.count[a] == 0) return;
      r.target += r.low[a] * targetStride;
      r.source += (r.low[a] - steps[a] * w) * sourceStride;
      targetStride *= t.targetWidth, sourceStride *= t.sourceWidth;
    }
    t.offsets[r.direction] = r.source;
    r.around = Block::steps(step.x, step.y, step.z);
    auto const place = static_cast<std::size_t>(Block::kFirst + r.around);
    t.around |= std::uint64_t(1) << place;
    std::size_t longAxes = TileWidth == 2 && w == 4 ? 0 : 8;
    for (std::size_t a = 0; a < 3; ++a)
      longAxes |= r.count[a] == w ? std::size_t(1) << a : r.count[a] == 1 ? 0 : 8;
    if (longAxes < 8) t.aroundByLength[longAxes] |= std::uint64_t(1) << place;
    t.regionAt[place] = static_cast<std::uint8_t>(t.regionCount);
    t.regions[t.regionCount++] = r;
  };
  for (int3 const step : {int3{1, 0, 0}, int3{0, 1, 0}, int3{0, 0, 1}, int3{1, 1, 0}, int3{1, 0, 1},
                          int3{0, 1, 1}, int3{1, 1, 1}})
    add(step);
  for (int d = 0; d < kNeighborCount; ++d) {
    int3 const step = neighborOffset(d);
    if (step.x < 0 || step.y < 0 || step.z < 0) add(step);
  }

  int const largest =
      target.core - 1 < target.core + target.halo - 2 ? target.core - 1 : target.core + target.halo - 2;
  for (int child = 0; child < tileWidth; ++child)
    for (int n = 0; n < t.targetWidth; ++n)
      t.parentAxis[child][n] = parentAxisAt(child, n - target.halo, w, tileWidth, largest);
  return t;
}

/// Layouts of the tiles of a tree with W samples along a tile.
constexpr ChannelLayout haloLayout(int tileDataWidth, int extended, int halo) {
  int const width = tileDataWidth + extended + 2 * halo;
  return {tileDataWidth + extended, halo, extended, tileDataWidth, width * width * width, 0};
}

template <class TraitsT, int SourceExtended, int SourceHalo, int TargetExtended, int TargetHalo>
inline constexpr HaloTable
    kHaloTable = makeHaloTable<TraitsT::kTW>(haloLayout(TraitsT::kTDW, SourceExtended, SourceHalo),
                                             haloLayout(TraitsT::kTDW, TargetExtended, TargetHalo));

// Where a slot of the block lies: the parent, or the tile beside it in a direction, and the child's slot
// there.
struct NeighborSlot {
  NeighborDirection direction = kNeighborSelf;
  std::uint8_t slot = 0;
};
template <int Width> constexpr auto makeNeighborSlots() {
  constexpr int across = Width + 2;
  std::array<NeighborSlot, std::size_t(across) * across * across> table{};
  auto const side = [](int s) { return s < 0 ? -1 : s >= Width ? 1 : 0; };
  std::size_t n = 0;
  for (int k = -1; k <= Width; ++k)
    for (int j = -1; j <= Width; ++j)
      for (int i = -1; i <= Width; ++i) {
        int const slot =
            (i - side(i) * Width) + Width * ((j - side(j) * Width) + Width * (k - side(k) * Width));
        table[n++] = {neighborDirection(side(i), side(j), side(k)), static_cast<std::uint8_t>(slot)};
      }
  return table;
}
template <int Width> inline constexpr auto kNeighborSlots = makeNeighborSlots<Width>();

/// By direction: steps from slot to slot of the block.
template <int Width> constexpr auto makeBlockSteps() {
  constexpr int across = Width + 2;
  std::array<int, kNeighborCount> table{};
  for (int d = 0; d < kNeighborCount; ++d) {
    int3 const step = neighborOffset(d);
    table[d] = step.x + across * (step.y + across * step.z);
  }
  return table;
}
template <int Width> inline constexpr auto kBlockSteps = makeBlockSteps<Width>();

/// By direction of an owner: the slots of the block that it owns, ended by kEnd.
struct NeighborPlace {
  static constexpr std::uint8_t kEnd = 0xff;

  std::uint8_t place = kEnd; ///< in the block
  std::uint8_t slot = 0;     ///< among the owner's children
};
template <int Width> constexpr auto makeNeighborPlaces() {
  std::array<std::array<NeighborPlace, std::size_t(Width) * Width * Width + 1>, kNeighborCount> table{};
  std::array<std::size_t, kNeighborCount> count{};
  for (std::size_t n = 0; n < kNeighborSlots<Width>.size(); ++n) {
    auto const& in = kNeighborSlots<Width>[n];
    table[in.direction][count[in.direction]++] = {static_cast<std::uint8_t>(n), in.slot};
  }
  return table;
}
template <int Width> inline constexpr auto kNeighborPlaces = makeNeighborPlaces<Width>();

/// By slot of a child in the block: the tiles that own the 27 slots round it.
template <int Width> constexpr auto makeOwnersRound() {
  constexpr int across = Width + 2;
  std::array<std::uint32_t, std::size_t(across) * across * across> table{};
  for (int k = 0; k < Width; ++k)
    for (int j = 0; j < Width; ++j)
      for (int i = 0; i < Width; ++i)
        for (int d = 0; d < kNeighborCount; ++d) {
          int3 const step = neighborOffset(d);
          auto const slot = [](int3 const& p) {
            return static_cast<std::size_t>((p.x + 1) + across * ((p.y + 1) + across * (p.z + 1)));
          };
          auto const& in = kNeighborSlots<Width>[slot({i + step.x, j + step.y, k + step.z})];
          table[slot({i, j, k})] |= 1u << in.direction;
        }
  return table;
}
template <int Width> inline constexpr auto kOwnersRound = makeOwnersRound<Width>();
/// The tile itself and those without a negative step: the owners of all that a target without halo reads.
inline constexpr std::uint32_t kOwnersAhead = [] {
  std::uint32_t owners = 0;
  for (int d = 0; d < kNeighborCount; ++d) {
    int3 const step = neighborOffset(d);
    if (step.x >= 0 && step.y >= 0 && step.z >= 0) owners |= 1u << d;
  }
  return owners;
}();

template <int N>
constexpr auto kNoChildren = [] {
  std::array<std::int64_t, N> table{};
  for (auto& child : table) child = -1;
  return table;
}();

} // namespace VLN::TileTree3D::Internal
