// Pictures with opacity, as files.
#pragma once

#include "GeometryVolume/core/Export.h"

#include <cstdint>
#include <string>
#include <vector>

namespace VLN::Interop {

/// Writes a PNG file of four bytes a pixel, row by row from the top: sRGB, and an opacity by which the
/// colours are not multiplied. Where every opacity is 255 the file has three channels.
/// @error FileError; no file is left half-written.
VLN_API void writeRgbaPng(std::string const& path, int width, int height,
                          std::vector<std::uint8_t> const& pixels);

} // namespace VLN::Interop
