#include "GeometryVolume/channels/HaloKernels.h"

#include <cassert>
#include <cstring>
#include <type_traits>

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

template <std::size_t Size> constexpr HaloKernels kKernels{copyBox<Size>, fillBox<Size>, gatherBox<Size>};

} // namespace

HaloKernels const& haloKernels(std::size_t elementSize) {
  switch (elementSize) {
  case 1:
    return kKernels<1>;
  case 2:
    return kKernels<2>;
  case 4:
    return kKernels<4>;
  case 8:
    return kKernels<8>;
  case 12:
    return kKernels<12>;
  case 16:
    return kKernels<16>;
  case 24:
    return kKernels<24>;
  case 32:
    return kKernels<32>;
  case 36:
    return kKernels<36>;
  default:
    break;
  }
  assert(elementSize == 64);
  return kKernels<64>;
}

} // namespace VLN::TileTree3D::Internal
