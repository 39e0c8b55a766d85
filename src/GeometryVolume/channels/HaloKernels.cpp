#include "GeometryVolume/channels/HaloKernelsImpl.h"
#include "GeometryVolume/channels/HaloRegionsImpl.h"

#include <algorithm>
#include <cassert>
#include <cstring>
#include <type_traits>
#include <utility>

namespace VLN::TileTree3D::Internal {

namespace {

// An element as bytes. memcpy of a constant count is a few moves, and aliases with anything.
template <std::size_t Size> void copyElement(std::byte* to, std::byte const* from) {
  std::memcpy(to, from, Size);
}

// Elements of a row, rows of a plane: whole ones of both shapes and single ones, which are common, have
// constant counts.
template <class Row> void forCount(int count, Row const& row) {
  switch (count) {
  case 1:
    row(std::integral_constant<int, 1>());
    break;
  case 4:
    row(std::integral_constant<int, 4>());
    break;
  case 5:
    row(std::integral_constant<int, 5>());
    break;
  default:
    row(count);
  }
}

template <std::size_t Size> void copyBox(BoxMove const& m) {
  auto* const target = static_cast<std::byte*>(m.target);
  auto const* const source = static_cast<std::byte const*>(m.source);
  auto const bytes = [](int elements) {
    return static_cast<std::ptrdiff_t>(elements) * std::ptrdiff_t(Size);
  };
  std::ptrdiff_t const tj = bytes(m.targetWidth), sj = bytes(m.sourceWidth);
  std::ptrdiff_t const tk = tj * m.targetWidth, sk = sj * m.sourceWidth;
  forCount(m.count[0], [&](auto n) {
    forCount(m.count[1], [&](auto rows) {
      std::byte* to = target;
      std::byte const* from = source;
      for (int k = 0; k < m.count[2]; ++k, to += tk, from += sk)
        for (int j = 0; j < rows; ++j) std::memcpy(to + j * tj, from + j * sj, std::size_t(bytes(n)));
    });
  });
}

template <std::size_t Size> void fillBox(BoxMove const& m) {
  auto* const target = static_cast<std::byte*>(m.target);
  auto const* const value = static_cast<std::byte const*>(m.source);
  std::ptrdiff_t const w = m.targetWidth;
  for (int k = 0; k < m.count[2]; ++k)
    for (int j = 0; j < m.count[1]; ++j) {
      std::byte* const row = target + (k * w * w + j * w) * std::ptrdiff_t(Size);
      for (int i = 0; i < m.count[0]; ++i) copyElement<Size>(row + i * std::ptrdiff_t(Size), value);
    }
}

template <std::size_t Size> void gatherBox(BoxGather const& m) {
  auto* const target = static_cast<std::byte*>(m.target);
  auto const* const source = static_cast<std::byte const*>(m.source);
  std::ptrdiff_t const w = m.targetWidth;
  for (int k = 0; k < m.count[2]; ++k)
    for (int j = 0; j < m.count[1]; ++j) {
      std::byte* const row = target + (k * w * w + j * w) * std::ptrdiff_t(Size);
      std::byte const* const from = source + (m.j[j] + m.k[k]) * std::ptrdiff_t(Size);
      for (int i = 0; i < m.count[0]; ++i)
        copyElement<Size>(row + i * std::ptrdiff_t(Size), from + m.i[i] * std::ptrdiff_t(Size));
    }
}

// Where the sources of one step along j and k are read: low, core and high along i. With plain sources, which
// are nothing but the tree's samples, every offset is a constant.
template <std::size_t Size, int W, int Low, bool Plain> struct RowSources {
  using Block = PointerBlock<(W == PowerOfTwoTraits::kTDW ? PowerOfTwoTraits::kTW : OddTraits::kTW)>;

  template <int I, int J, int K> static std::byte const* first(TileMove const& m) {
    auto const* const elements = static_cast<std::byte const*>(m.around[Block::steps(I, J, K)]);
    constexpr auto kNearest = [](int step) { return step < 0 ? W - Low : 0; };
    if constexpr (Plain)
      return elements + (kNearest(I) + W * (kNearest(J) + W * kNearest(K))) * std::ptrdiff_t(Size);
    else
      return elements + m.offsets[neighborDirection(I, J, K)] * std::ptrdiff_t(Size);
  }
};

// The rows of one plane and one step along j. Every count is a constant.
template <std::size_t Size, int W, int Low, int High, bool Plain, int J, int K>
std::byte* copyRows(TileMove const& m, int k, std::byte* to) {
  using Sources = RowSources<Size, W, Low, Plain>;
  constexpr int kRows = J < 0 ? Low : J > 0 ? High : W;
  std::ptrdiff_t const stride = (Plain ? W : m.sourceWidth) * std::ptrdiff_t(Size);
  std::ptrdiff_t const plane = k * (Plain ? W : m.sourceWidth) * stride;
  std::byte const* const low = Low > 0 ? Sources::template first<-1, J, K>(m) + plane : nullptr;
  std::byte const* const core = Sources::template first<0, J, K>(m) + plane;
  std::byte const* const high = Sources::template first<1, J, K>(m) + plane;
#pragma GCC unroll 5
  for (int j = 0; j < kRows; ++j, to += (Low + W + High) * Size) {
    if constexpr (Low > 0) std::memcpy(to, low + j * stride, Low * Size);
    std::memcpy(to + Low * Size, core + j * stride, W * Size);
    std::memcpy(to + (Low + W) * Size, high + j * stride, High * Size);
  }
  return to;
}

template <std::size_t Size, int W, int Low, int High, bool Plain, int K>
std::byte* copyPlanes(TileMove const& m, std::byte* to) {
  for (int k = 0; k < (K < 0 ? Low : K > 0 ? High : W); ++k) {
    if constexpr (Low > 0) to = copyRows<Size, W, Low, High, Plain, -1, K>(m, k, to);
    to = copyRows<Size, W, Low, High, Plain, 0, K>(m, k, to);
    to = copyRows<Size, W, Low, High, Plain, 1, K>(m, k, to);
  }
  return to;
}

template <std::size_t Size, int W, int Low, int High, bool Plain> void copyPlanesOf(TileMove const& m) {
  auto* to = static_cast<std::byte*>(m.target);
  if constexpr (Low > 0) to = copyPlanes<Size, W, Low, High, Plain, -1>(m, to);
  to = copyPlanes<Size, W, Low, High, Plain, 0>(m, to);
  copyPlanes<Size, W, Low, High, Plain, 1>(m, to);
}

// The target is written from its first byte to its last.
template <std::size_t Size, int W, int Low, int High> void copyTile(TileMove const& m) {
  if (m.sourceWidth == W)
    copyPlanesOf<Size, W, Low, High, true>(m);
  else
    copyPlanesOf<Size, W, Low, High, false>(m);
}

template <std::size_t Size>
constexpr HaloKernels kKernels{copyBox<Size>,
                               fillBox<Size>,
                               gatherBox<Size>,
                               {copyTile<Size, 4, 0, 1>, copyTile<Size, 4, 1, 1>},
                               {copyTile<Size, 5, 0, 1>, copyTile<Size, 5, 1, 1>}};

template <std::size_t... N>
constexpr std::array<HaloKernels, sizeof...(N)> makeKernels(std::index_sequence<N...>) {
  return {kKernels<kHaloElementSizes[N]>...};
}
constexpr auto kTable = makeKernels(std::make_index_sequence<kHaloElementSizes.size()>());

} // namespace

HaloKernels const& haloKernels(std::size_t elementSize) {
  auto const at = std::find(kHaloElementSizes.begin(), kHaloElementSizes.end(), elementSize);
  assert(at != kHaloElementSizes.end());
  return kTable[at - kHaloElementSizes.begin()];
}

} // namespace VLN::TileTree3D::Internal
