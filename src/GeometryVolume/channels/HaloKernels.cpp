#include "GeometryVolume/channels/HaloKernelsImpl.h"

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

// The rows of one plane and one step along j. Every count is a constant, and all that changes is a local.
template <std::size_t Size, int W, int Low, int High, int Rows>
std::byte* copyRows(TileMove const& m, int jk, std::ptrdiff_t plane, std::byte* to) {
  auto const first = [&](int direction) {
    auto const d = static_cast<std::size_t>(direction);
    return static_cast<std::byte const*>(m.sources[d]) + m.offsets[d] * std::ptrdiff_t(Size) + plane;
  };
  std::byte const* low = Low ? first(jk) : nullptr;
  std::byte const* core = first(9 + jk);
  std::byte const* high = first(18 + jk);
  std::ptrdiff_t const stride = m.sourceWidth * std::ptrdiff_t(Size);
  for (int j = 0; j < Rows; ++j, core += stride, high += stride, to += (Low + W + High) * Size) {
    if constexpr (Low > 0) {
      std::memcpy(to, low, Low * Size);
      low += stride;
    }
    std::memcpy(to + Low * Size, core, W * Size);
    std::memcpy(to + (Low + W) * Size, high, High * Size);
  }
  return to;
}

// The target is written from its first byte to its last.
template <std::size_t Size, int W, int Low, int High> void copyTile(TileMove const& m) {
  auto* to = static_cast<std::byte*>(m.target);
  std::ptrdiff_t const plane = m.sourceWidth * m.sourceWidth * std::ptrdiff_t(Size);
  constexpr int kCounts[3] = {Low, W, High};
  for (int step = Low ? 0 : 1; step < 3; ++step)
    for (int k = 0; k < kCounts[step]; ++k) {
      if constexpr (Low > 0) to = copyRows<Size, W, Low, High, Low>(m, step, k * plane, to);
      to = copyRows<Size, W, Low, High, W>(m, 3 + step, k * plane, to);
      to = copyRows<Size, W, Low, High, High>(m, 6 + step, k * plane, to);
    }
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
  return kTable[static_cast<std::size_t>(at - kHaloElementSizes.begin())];
}

} // namespace VLN::TileTree3D::Internal
