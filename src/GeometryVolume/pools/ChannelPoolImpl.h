// What the pool of channels must know of a channel's type. Only the generated sources and ChannelPool.cpp
// include this.
#pragma once

#include "GeometryVolume/channels/Channel.h"
#include "GeometryVolume/core/ElementTypes.h"
#include "GeometryVolume/core/Parallel.h"

#include <algorithm>
#include <cstdint>
#include <type_traits>

namespace VLN::TileTree3D::ChannelPool::Internal {

/// One kind of channel: names and indices for the log, and the few operations that need the type.
struct ChannelKind {
  char const* traitsName;
  char const* typeName;
  int E, H;
  int extended; ///< E less the width of the tree's tile data.
  int traitsIndex, layoutIndex, typeIndex;
  std::uint64_t tileBytes;

  Ostil::Ptr<ChannelBase> (*make)(void const* defaultValue, bool useStaticAllocation,
                                  bool callElementConstructor, int minDepth, int depth);
  bool (*callElementConstructor)(ChannelBase const& channel);
  void (*configure)(ChannelBase& channel, void const* defaultValue, bool callElementConstructor);
  /// Sets all elements.
  void (*reset)(ChannelBase& channel, void const* value, int maxDepth);

  std::size_t store() const {
    return static_cast<std::size_t>((traitsIndex * kMadeLayoutCount + layoutIndex) * kElementTypeCount +
                                    typeIndex);
  }
};
inline constexpr std::size_t kStoreCount = std::size_t(kShapeCount) * kMadeLayoutCount * kElementTypeCount;

/// Place of a layout among the stores of a shape and element type: those with halo behind the others.
constexpr int layoutIndexOf(int extended, int halo) { return halo > 0 ? 1 + halo : extended; }
#define VLN_CHECK_LAYOUT(extended, halo) static_assert(layoutIndexOf(extended, halo) < kMadeLayoutCount);
VLN_FOR_EACH_MADE_LAYOUT(VLN_CHECK_LAYOUT)
#undef VLN_CHECK_LAYOUT
#define VLN_STORE_BIT(type, name, pool, ...) | 1ull << pool
static_assert((0 VLN_FOR_EACH_KNOWN_ELEMENT_TYPE(VLN_STORE_BIT)) == (1ull << kElementTypeCount) - 1,
              "the places of element types among the pool's stores are 0, 1, 2, ..., each once");
#undef VLN_STORE_BIT

struct Request {
  void const* defaultValue;
  bool useStaticAllocation, callElementConstructor;
  int minDepth, depth;
  std::uint64_t tileCount;
  Component const* component;
};

Ostil::Ptr<ChannelBase> allocate(ChannelKind const& kind, Request const& request);

// By element type

template <class T> bool callsElementConstructor(ChannelBase const& channel) {
  return static_cast<TypedChannel<T> const&>(channel).callElementConstructor();
}
template <class T>
void configure(ChannelBase& channel, void const* defaultValue, bool callElementConstructor) {
  auto& typed = static_cast<TypedChannel<T>&>(channel);
  typed.setCallElementConstructor(callElementConstructor);
  typed.setDefaultValue(static_cast<T const*>(defaultValue));
}
template <class T> void reset(ChannelBase& channel, void const* value, int maxDepth) {
  auto& typed = static_cast<TypedChannel<T>&>(channel);
  // The last holder may have copied the channel: the copy keeps its values.
  auto const storage = typed.cloneData();
  int const first = std::max(0, channel.minDepth()), last = std::min(maxDepth, channel.depth());
  parallelFor(first, last + 1, [&](std::int64_t begin, std::int64_t end) {
    for (std::int64_t d = begin; d < end; ++d) {
      auto& tiles = (*storage)[d];
      parallelFor(0, static_cast<std::int64_t>(tiles.size()), [&](std::int64_t b, std::int64_t e) {
        for (std::int64_t t = b; t < e; ++t) {
          auto& tile = tiles[t];
          std::fill(tile.begin(), tile.end(), *static_cast<T const*>(value));
        }
      });
    }
  });
}

// By class

template <class C>
Ostil::Ptr<ChannelBase> make(void const* value, bool isStatic, bool construct, int lo, int hi) {
  using T = typename C::value_type;
  return Ostil::makePtr<C>("channel_pool", static_cast<T const*>(value), kInitializeNone, isStatic, construct,
                           lo, hi);
}

template <class C> constexpr ChannelKind kindOf() {
  using Traits = typename C::Traits;
  using T = typename C::value_type;
  constexpr bool isPowerOfTwo = std::is_same_v<Traits, PowerOfTwoTraits>;
  return {isPowerOfTwo ? "Traits<2,4,0,1>" : "Traits<5,5,0,1>",
          kElementType<T>.name,
          C::kLayout.core,
          C::kHalo,
          C::kExtended,
          isPowerOfTwo ? 0 : 1,
          layoutIndexOf(C::kExtended, C::kHalo),
          kElementType<T>.poolIndex,
          static_cast<std::uint64_t>(C::kSize) * sizeof(T),
          &make<C>,
          &callsElementConstructor<T>,
          &configure<T>,
          &reset<T>};
}

} // namespace VLN::TileTree3D::ChannelPool::Internal
