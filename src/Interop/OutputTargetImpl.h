#pragma once

#include <cstddef>
#include <string>

namespace VLN::Interop {

/// What a name that is to be written to stands for.
struct OutputTarget {
  std::string path;      ///< behind all symbolic links; need not exist yet
  bool straight = false; ///< a pipe, a device, or a descriptor: nothing that could be replaced
  int descriptor = -1;   ///< of this process that the name stands for, as /dev/stdout does; -1 for none
};

/// @error FileError for a folder, a file that may not be written, and a name that cannot be one.
OutputTarget findOutputTarget(std::string const& path);

/// Writes all bytes, however many calls that takes. @return 0, or an error number.
int writeAll(int descriptor, void const* bytes, std::size_t count);

} // namespace VLN::Interop
