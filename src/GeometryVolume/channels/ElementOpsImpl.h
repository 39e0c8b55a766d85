// The operations of one element type. Only the generated sources include this.
#pragma once

#include "GeometryVolume/channels/ChannelData.h"
#include "GeometryVolume/channels/ElementOpsTableImpl.h"
#include "GeometryVolume/channels/ElementTraits.h"

#include <algorithm>
#include <memory>

namespace VLN::TileTree3D::Internal {

/// Trilinear blend of eight elements, given as corner(n) with i fastest: along i, then j, then k.
/// @numeric Formed in the type that the elements blend in and converted once. 64-bit integers, which that
/// type does not hold exactly, are kept within the range of their corners.
template <class T, class Corner>
inline T blendEight(Corner const& corner, typename ElementTraits<T>::Blend fi,
                    typename ElementTraits<T>::Blend fj, typename ElementTraits<T>::Blend fk) {
  using Traits = ElementTraits<T>;
  using Blend = typename Traits::Blend;
  T result;
  for (int c = 0; c < Traits::kComponents; ++c) {
    auto const value = [&](int n) { return Traits::toBlend(Traits::component(corner(n), c)); };
    auto const lerp = [](Blend a, Blend b, Blend f) { return (b - a) * f + a; };
    Blend const v00 = lerp(value(0), value(1), fi), v10 = lerp(value(2), value(3), fi);
    Blend const v01 = lerp(value(4), value(5), fi), v11 = lerp(value(6), value(7), fi);
    auto blended = Traits::fromBlend(lerp(lerp(v00, v10, fj), lerp(v01, v11, fj), fk));
    if constexpr (Traits::kIsInteger && sizeof(blended) == 8) {
      auto low = Traits::component(corner(0), c), high = low;
      for (int n = 1; n < 8; ++n) {
        low = std::min(low, Traits::component(corner(n), c));
        high = std::max(high, Traits::component(corner(n), c));
      }
      blended = std::clamp(blended, low, high);
    }
    Traits::component(result, c) = blended;
  }
  return result;
}

/// TypedElementOps::blendParent() of floats.
void blendFloats(ParentBlend const& b, std::uint64_t regions);
/// TypedElementOps::blendBox() of floats.
/// @pre The scale is 1.
void blendFloats(BoxBlend const& b);

template <class T> struct TypedElementOps {
  using Traits = ElementTraits<T>;
  using Blend = typename Traits::Blend;

  static void const* elements(void const* tileArrays, TreeIndex const& at, int count) {
    auto const& tiles = (*static_cast<TileArrays<T> const*>(tileArrays))[at.depth];
    if (at.index < 0 || static_cast<std::size_t>(at.index) >= tiles.size()) return nullptr;
    auto const& tile = tiles[at.index];
    return tile.size() >= static_cast<std::size_t>(count) ? tile.data() : nullptr;
  }

  static void elementsOf(void const* tileArrays, int depth, std::int64_t const* indices, int n, int count,
                         void const** found) {
    auto const& tiles = (*static_cast<TileArrays<T> const*>(tileArrays))[depth];
    std::size_t const size = tiles.size(), bytes = static_cast<std::size_t>(count) * sizeof(T);
    for (int i = 0; i < n; ++i) {
      // The first tile in place of one that is not there.
      auto const index = static_cast<std::size_t>(indices[i]);
      std::size_t const exists = index < size;
      found[i] = nullptr;
      if (size == 0) continue;
      auto const& tile = tiles[index & (0 - exists)];
      auto const begin = reinterpret_cast<std::uintptr_t>(tile.data());
      auto const end = reinterpret_cast<std::uintptr_t>(std::to_address(tile.end()));
      std::size_t const holds = exists & std::size_t(end - begin >= bytes);
      found[i] = reinterpret_cast<void const*>(begin & (0 - holds));
    }
  }

  static void fetchRecords(void const* tileArrays, int depth, std::int64_t const* indices, int n) {
    auto const& tiles = (*static_cast<TileArrays<T> const*>(tileArrays))[depth];
    for (int i = 0; i < n; ++i) {
      auto const index = static_cast<std::size_t>(indices[i]);
      __builtin_prefetch(tiles.data() + (index < tiles.size() ? index : 0));
    }
  }

  static void blendParent(ParentBlend const& b, std::uint64_t regions) {
    if constexpr (std::is_same_v<T, float>) return blendFloats(b, regions);
    int const w = b.table->targetWidth;
    int const offsets[8] = {0, 1, w, w + 1, w * w, w * w + 1, w * w + w, w * w + w + 1};
    for (; regions; regions &= regions - 1) {
      HaloRegion const& box = b.table->regionOf(regions);
      auto* const target = static_cast<T*>(b.target) + box.target;
      HaloAxis const *const ai = b.i + box.low[0], *const aj = b.j + box.low[1], *const ak = b.k + box.low[2];
      for (int k = 0; k < box.count[2]; ++k)
        for (int j = 0; j < box.count[1]; ++j)
          for (int i = 0; i < box.count[0]; ++i) {
            T const* const low = static_cast<T const*>(b.parent) + ai[i].at + (aj[j].at + ak[k].at * w) * w;
            target[i + (j + k * w) * w] =
                blendEight<T>([&](int n) -> T const& { return low[offsets[n]]; }, Blend(ai[i].fraction),
                              Blend(aj[j].fraction), Blend(ak[k].fraction));
          }
    }
  }

  static void blendCorners(CornerBlend const& b, void* out) {
    *static_cast<T*>(out) =
        blendEight<T>([&](int n) -> T const& { return *static_cast<T const*>(b.corners[n]); },
                      Blend(b.fraction[0]), Blend(b.fraction[1]), Blend(b.fraction[2]));
  }

  static void blendBox(BoxBlend const& b) {
    if constexpr (std::is_same_v<T, float>)
      if (b.scale == 1.0f) return blendFloats(b);
    int const rows = b.sampleCount[0], planes = rows * b.sampleCount[1], w = b.targetWidth;
    int const offsets[8] = {0, 1, rows, rows + 1, planes, planes + 1, planes + rows, planes + rows + 1};
    for (int k = 0; k < b.count[2]; ++k)
      for (int j = 0; j < b.count[1]; ++j)
        for (int i = 0; i < b.count[0]; ++i) {
          void const* const* const low = b.samples + b.at[0][i] + b.at[1][j] * rows + b.at[2][k] * planes;
          T& out = static_cast<T*>(b.target)[i + (j + k * w) * w];
          out = blendEight<T>([&](int n) -> T const& { return *static_cast<T const*>(low[offsets[n]]); },
                              Blend(b.fraction[0][i]), Blend(b.fraction[1][j]), Blend(b.fraction[2][k]));
          if (b.scale != 1.0f) scale(&out, b.scale);
        }
  }

  static void scale(void* element, float factor) {
    auto& value = *static_cast<T*>(element);
    value = Traits::scaled(value, Blend(factor));
  }

  static void broadcast(float constant, void* out) {
    auto& value = *static_cast<T*>(out);
    for (int c = 0; c < Traits::kComponents; ++c)
      Traits::component(value, c) = Traits::fromBlend(Blend(constant));
  }

  static double distance(void const* a, void const* b) {
    return Traits::distance(*static_cast<T const*>(a), *static_cast<T const*>(b));
  }

  static ElementOps const& get() {
    static_assert(std::find(kHaloElementSizes.begin(), kHaloElementSizes.end(), sizeof(T)) !=
                      kHaloElementSizes.end(),
                  "elements of a new size: add it to kHaloElementSizes");
    static ElementOps const ops{sizeof(T),    &haloKernels(sizeof(T)),
                                elements,     elementsOf,
                                fetchRecords, blendParent,
                                blendCorners, blendBox,
                                scale,        broadcast,
                                distance};
    return ops;
  }
};

} // namespace VLN::TileTree3D::Internal
