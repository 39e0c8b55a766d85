// Files that are read as a whole.
#pragma once

#include <cstdint>
#include <string>

namespace VLN::Interop {

/// The size of a file that can be read twice.
/// @error FileError for what is missing, empty, a directory, a pipe or a device, or cannot be opened.
std::uint64_t regularFileSize(std::string const& path);

/// All bytes of a file.
/// @error As regularFileSize(), but that a file may be empty.
std::string regularFileContent(std::string const& path);

} // namespace VLN::Interop
