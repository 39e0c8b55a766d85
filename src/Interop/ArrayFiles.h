// Files of arrays as volumes: .npz of numpy and .vti of VTK.
#pragma once

#include "Interop/VdbImport.h"

#include <string>

namespace VLN::Interop {

/// Whether a file is an archive of arrays, or an image of VTK, by its suffix or as it begins.
VLN_API bool isNpzFile(std::string const& path);
VLN_API bool isVtiFile(std::string const& path);

/// Reads an archive: arrays of three axes [x, y, z], or four with three components last, and pairs
/// NAME.indices and NAME.values; other arrays are named as skipped. What differs from the background is
/// active, of a pair what it names. See docs/formats.md for the arrays that tell places and backgrounds.
/// @error FileError, here and below: nothing in the file is trusted.
VLN_API VdbImport importNpz(std::string const& path, VdbReadLimits const& limits = {},
                            Progress const& progress = {});

/// Reads an image: point and cell data of one or three components, as text, base64 or raw bytes, compressed
/// with zlib or not.
VLN_API VdbImport importVti(std::string const& path, VdbReadLimits const& limits = {},
                            Progress const& progress = {});

} // namespace VLN::Interop
