// Which layouts are filled from which: the one list for each form of the halo functions. Their concepts and
// instantiations follow from it.
#pragma once

#include "GeometryVolume/channels/ChannelLayouts.h"

/// computeHalo() of the plain form: X(source extended, source halo, target extended, target halo, more...).
#define VLN_FOR_EACH_PLAIN_HALO(X, ...)                                                                      \
  X(0, 0, 0, 0 __VA_OPT__(, ) __VA_ARGS__)                                                                   \
  X(0, 0, 0, 1 __VA_OPT__(, ) __VA_ARGS__)                                                                   \
  X(0, 0, 1, 0 __VA_OPT__(, ) __VA_ARGS__)                                                                   \
  X(0, 1, 1, 0 __VA_OPT__(, ) __VA_ARGS__)                                                                   \
  X(1, 0, 1, 0 __VA_OPT__(, ) __VA_ARGS__)

/// setHaloTile() of the plain form, in the same order. Tiles of (1,1) are in no channel.
#define VLN_FOR_EACH_TILE_HALO(X, ...)                                                                       \
  VLN_FOR_EACH_PLAIN_HALO(X __VA_OPT__(, ) __VA_ARGS__)                                                      \
  X(0, 1, 1, 1 __VA_OPT__(, ) __VA_ARGS__)

/// computeHalo() with modes, of layouts that are not extended: X(source halo, target halo, more...).
#define VLN_FOR_EACH_MODE_HALO(X, ...)                                                                       \
  X(0, 1 __VA_OPT__(, ) __VA_ARGS__)                                                                         \
  X(0, 2 __VA_OPT__(, ) __VA_ARGS__)                                                                         \
  X(1, 1 __VA_OPT__(, ) __VA_ARGS__)

/// setHaloTile() with modes: X(source halo, target halo, source extended, target extended, more...).
#define VLN_FOR_EACH_INDEX_HALO(X, ...)                                                                      \
  X(0, 0, 0, 1 __VA_OPT__(, ) __VA_ARGS__)                                                                   \
  X(0, 0, 1, 1 __VA_OPT__(, ) __VA_ARGS__)                                                                   \
  X(0, 1, 0, 0 __VA_OPT__(, ) __VA_ARGS__)                                                                   \
  X(0, 1, 0, 1 __VA_OPT__(, ) __VA_ARGS__)                                                                   \
  X(0, 1, 1, 0 __VA_OPT__(, ) __VA_ARGS__)                                                                   \
  X(0, 1, 1, 1 __VA_OPT__(, ) __VA_ARGS__)                                                                   \
  X(0, 2, 0, 0 __VA_OPT__(, ) __VA_ARGS__)                                                                   \
  X(1, 1, 0, 0 __VA_OPT__(, ) __VA_ARGS__)

namespace VLN::TileTree3D {

#define VLN_MATCH(a, b, c, d) || (A == a && B == b && C == c && D == d)
/// (source extended, source halo, target extended, target halo)
template <int A, int B, int C, int D>
concept PlainHaloLayouts = false VLN_FOR_EACH_PLAIN_HALO(VLN_MATCH);
template <int A, int B, int C, int D>
concept TileHaloLayouts = false VLN_FOR_EACH_TILE_HALO(VLN_MATCH);
/// (source halo, target halo, source extended, target extended)
template <int A, int B, int C, int D>
concept IndexHaloLayouts = false VLN_FOR_EACH_INDEX_HALO(VLN_MATCH);
#undef VLN_MATCH

#define VLN_MATCH(a, b) || (SourceHalo == a && TargetHalo == b)
template <int SourceHalo, int TargetHalo>
concept ModeHaloLayouts = false VLN_FOR_EACH_MODE_HALO(VLN_MATCH);
#undef VLN_MATCH

} // namespace VLN::TileTree3D
