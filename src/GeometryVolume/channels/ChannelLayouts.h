// The layouts of channels: the one list of them.
//
// A layout is (extended, halo): samples by which the core is wider than the tree's tiles, and layers round
// it. Channel<Traits, T, E, H> has E = Traits::kTDW + extended and H = halo.
#pragma once

#include "GeometryVolume/tiletree/Traits.h"

#include <initializer_list>

/// Expands X(extended, halo, more...) for each layout that commands make, pools hold, and coarse values fill.
#define VLN_FOR_EACH_MADE_LAYOUT(X, ...)                                                                     \
  X(0, 0 __VA_OPT__(, ) __VA_ARGS__)                                                                         \
  X(0, 1 __VA_OPT__(, ) __VA_ARGS__)                                                                         \
  X(1, 0 __VA_OPT__(, ) __VA_ARGS__)

/// The same for all layouts.
#define VLN_FOR_EACH_LAYOUT(X, ...)                                                                          \
  VLN_FOR_EACH_MADE_LAYOUT(X __VA_OPT__(, ) __VA_ARGS__)                                                     \
  X(0, 2 __VA_OPT__(, ) __VA_ARGS__)

/// Expands X(traits, type, E, H) for each channel class of an element type, and for those of made layouts.
#define VLN_FOR_EACH_CHANNEL_OF(type, X) VLN_FOR_EACH_LAYOUT(VLN_CHANNELS_OF_LAYOUT, type, X)
#define VLN_FOR_EACH_MADE_CHANNEL_OF(type, X) VLN_FOR_EACH_MADE_LAYOUT(VLN_CHANNELS_OF_LAYOUT, type, X)
#define VLN_CHANNELS_OF_LAYOUT(extended, halo, type, X)                                                      \
  X(::VLN::TileTree3D::PowerOfTwoTraits, type, ::VLN::TileTree3D::PowerOfTwoTraits::kTDW + extended, halo)   \
  X(::VLN::TileTree3D::OddTraits, type, ::VLN::TileTree3D::OddTraits::kTDW + extended, halo)

namespace VLN::TileTree3D {

#define VLN_MATCH(e, h) || (extended == e && halo == h)
constexpr bool isLayout(int extended, int halo) { return false VLN_FOR_EACH_LAYOUT(VLN_MATCH); }
#undef VLN_MATCH

#define VLN_COUNT(...) +1
inline constexpr int kMadeLayoutCount = 0 VLN_FOR_EACH_MADE_LAYOUT(VLN_COUNT);
#undef VLN_COUNT

/// Samples along the widest tile of any layout and shape, halo included.
inline constexpr int kLargestChannelTileWidth = [] {
  int added = 0;
#define VLN_ADDED_WIDTH(extended, halo) , extended + 2 * halo
  for (int const width : {0 VLN_FOR_EACH_LAYOUT(VLN_ADDED_WIDTH)}) added = width > added ? width : added;
#undef VLN_ADDED_WIDTH
  return added + (PowerOfTwoTraits::kTDW > OddTraits::kTDW ? PowerOfTwoTraits::kTDW : OddTraits::kTDW);
}();

} // namespace VLN::TileTree3D
