// OpenEXR files, as plain as the format allows: rows from the top, floats, no compression.
#pragma once

#include "GeometryVolume/core/Export.h"

#include <string>
#include <vector>

namespace VLN::Interop {

struct ExrChannel {
  std::string name;                 ///< 1 to 31 characters
  std::vector<float> const* values; ///< width x height, row by row from the top
};

/// @source "OpenEXR File Layout" of the format's documentation: one part, scan lines, version 2.
/// @error FileError; no file is left half-written.
VLN_API void writeExr(std::string const& path, int width, int height, std::vector<ExrChannel> channels);

} // namespace VLN::Interop
