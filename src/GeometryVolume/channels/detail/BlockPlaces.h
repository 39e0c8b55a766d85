// BlockPlaces: which tile of a block holds a sample, and which of its elements the sample is.
//
//   axis i of 2 tiles of 4 samples    0  1  2  3 | 4  5  6  7
//   slot                              0  0  0  0 | 1  1  1  1      times 1, 2, 4 for i, j, k
//   element                           0  1  2  3 | 0  1  2  3      times 1, W, W * W
//
// Looked up for each axis and added: half of the arithmetic that it stands for.
#pragma once

#include <array>
#include <cstddef>
#include <cstdint>

namespace VLN::TileTree3D::Internal {

/// Blocks of kSlots^3 tiles of kSamples^3 samples, whose elements lie kWidth in a row from element kFirst on.
template <int kSlots, int kSamples, int kWidth, int kFirst> class BlockPlaces {
public:
  static constexpr int kBlockWidth = kSlots * kSamples;

  struct Place {
    std::uint32_t code;
    std::size_t slot() const { return code >> kElementBits; }
    std::size_t element() const { return code & ((1u << kElementBits) - 1); }
  };
  /// @pre Coordinates from the block's corner, each in 0 .. kBlockWidth - 1.
  static Place find(std::uint32_t x, std::uint32_t y, std::uint32_t z) {
    return {kCodes[0][x] + kCodes[1][y] + kCodes[2][z]};
  }

private:
  static constexpr int kElementBits = 16;
  static_assert(kWidth * kWidth * kWidth <= 1 << kElementBits && kSlots <= 16);

  static constexpr auto kCodes = [] {
    std::array<std::array<std::uint32_t, kBlockWidth>, 3> codes{};
    std::uint32_t slot = 1, element = 1;
    for (auto& axis : codes) {
      std::uint32_t c = 0;
      for (auto& code : axis) {
        code = (c / kSamples * slot) << kElementBits | c % kSamples * element;
        ++c;
      }
      slot *= kSlots, element *= kWidth;
    }
    for (auto& code : codes[0]) code += kFirst;
    return codes;
  }();
};

} // namespace VLN::TileTree3D::Internal
