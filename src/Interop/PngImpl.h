// Pixels as the bytes of a PNG file.
#pragma once

#include <vector>

namespace VLN::Interop {

enum class PixelBytes { kRgb, kRgba };

/// @shape `width` x `height` pixels, row by row from the top, a byte for each component (sRGB, alpha not
/// multiplied in).
/// @error std::runtime_error where libpng refuses.
std::vector<unsigned char> codePng(void const* pixels, int width, int height, PixelBytes bytes);

} // namespace VLN::Interop
