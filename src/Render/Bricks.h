// Bricks: a field at one depth as cubes of 8^3 samples of a byte, for what draws it without the buffer.
//
//      +---+---+--+          a brick of level n is 8 * 4^n samples of the depth wide and has 9 samples an
//      axis: |   | 0 | 0|  1       the last ones are the first of its neighbours, so that every blend stays
//      in it.
//      +---+---+--+          Level 0 where there is detail, higher ones where the tree is coarse.
//
// In a brick the code c stands for low + (high - low) * c / 255: no sample is off by more than 1/508 of the
// range of the brick's samples. Where there are values of both signs 0 is a code, up to rounding.
#pragma once

#include "Render/Field.h"

#include <cstdint>
#include <vector>

namespace VLN::Render {

inline constexpr int kPackedCore = 8;
inline constexpr int kPackedWidth = kPackedCore + 1;
inline constexpr int kPackedSamples = kPackedWidth * kPackedWidth * kPackedWidth;

struct PackedBrick {
  std::uint32_t x = 0, y = 0, z = 0; ///< in bricks of its level, from the origin
  std::uint32_t level = 0;
  float low = 0, high = 0; ///< its samples lie between; equal where they are, and then there are no codes
};

struct PackedField {
  int depth = 0;
  Vec3d origin;       ///< local position of sample (0, 0, 0)
  double spacing = 1; ///< of samples of level 0, in local space
  int levels = 1;     ///< the whole is one brick of this level wide
  std::vector<PackedBrick> bricks;
  std::vector<std::uint8_t> codes; ///< kPackedSamples for each brick whose values differ, x fastest
};

struct PackOptions {
  int depth = nanovtt::kMaxDepth; ///< nothing deeper is read
  std::size_t mostBricks = std::size_t(1) << 20;
  int threads = 0;
};

/// The depth at which samples are as near to each other as anywhere in the field.
VLN_RENDER_API int finestDepth(Field const& field);

/// Bricks for all tiles that hold anything but the background, at any depth, also above the roots. At the
/// finest depth samples are those of the tiles, and where the tree is not that deep blends of the coarser
/// ones, which the bricks' own blends repeat. At others they are means of those of the next depth, as far as
/// the next samples.
/// @return Nothing but the number of bricks, and no codes, where there are more than was allowed.
/// @edges Values beyond 1e38 count as 1e38.
/// @numeric The same for any number of threads.
VLN_RENDER_API PackedField packField(Field const& field, PackOptions const& options);

} // namespace VLN::Render
