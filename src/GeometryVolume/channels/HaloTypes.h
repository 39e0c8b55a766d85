// What a halo computation fills, and with what.
#pragma once

#include "GeometryVolume/tiletree/TreeIndex.h"

#include <cstdint>

namespace VLN::TileTree3D {

/// What a region takes when no tile of the tile's own depth serves it. The numbers are fixed.
enum HaloMode : std::int32_t {
  kHaloModeDeepOnly = 0,  ///< a linear sample where the neighbour is deeper than the channel, else nothing
  kHaloModeDefault = 1,   ///< the source's default value
  kHaloModeReplicate = 2, ///< the nearest element of the target's own core
  kHaloModeNearestCoarse = 3, ///< the coarser tile's sample that contains the element
  kHaloModeLinearCoarse = 4,  ///< a linear sample of the source, times the scale
  kHaloModeConstant = 5,      ///< the caller's constant
};

inline constexpr int kHaloModeCount = kHaloModeConstant + 1;
constexpr bool isHaloMode(std::int32_t mode) { return mode >= 0 && mode < kHaloModeCount; }

/// What is filled: a mask of these bits, and of haloSkip() for directions to leave alone.
enum HaloType : std::int32_t {
  kHaloFaces = 1,
  kHaloEdges = 2, ///< edges and corners
  kHaloCore = 4,
  kHaloAll = kHaloFaces | kHaloEdges | kHaloCore,
};

/// The bit that leaves the region in a direction alone.
constexpr HaloType haloSkip(NeighborDirection d) { return static_cast<HaloType>(1 << (3 + d)); }
constexpr HaloType operator|(HaloType a, HaloType b) {
  return static_cast<HaloType>(static_cast<std::int32_t>(a) | static_cast<std::int32_t>(b));
}

} // namespace VLN::TileTree3D
