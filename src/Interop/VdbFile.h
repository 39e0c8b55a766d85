// Safe reading of .vdb files. No type of OpenVDB shows here.
//
//   file --> header looked at --> every count and size looked at --> read
//                                          |
//                                          '--> read whole in a child process --> read for real, or the child
//                                               (memory and time bounded)          goes on
//
// OpenVDB trusts its input: a damaged file can make it ask for any amount of memory, loop, or crash. What is
// not plainly sound is met by a child process first, and only its verdict comes back.
#pragma once

#include "GeometryVolume/core/Export.h"

#include <cstdint>
#include <string>

namespace VLN::Interop {

struct VdbReadLimits {
  /// Most memory that reading the file may take, and then again most for the volumes made of it. 0: three
  /// quarters of what the machine has available.
  std::uint64_t memoryBytes = 0;
  /// Most processor time that reading the file may take. 0: ten seconds, and one more for each MB.
  unsigned seconds = 0;
  /// A filter of grids by name, as ChannelParser takes it: others are left out. Empty: all come in.
  std::string channels = {};
};

/// A grid that does not come in.
struct SkippedGrid {
  std::string grid;
  std::string reason;
};

/// Reads a whole file in a child process and drops what was read.
/// @error FileError that names the file and what is wrong with it: missing, not a regular file, of another
/// kind, truncated, damaged, or over a limit.
/// @threads No other thread may be calling OpenVDB meanwhile: its locks would stay taken in the child.
VLN_API void probeVdbFile(std::string const& path, VdbReadLimits const& limits = {});

/// Makes this process read the first file that takes a child once only, if it has no further threads by then:
/// the child that reads it within the limits goes on as the program, and this process waits for it and ends
/// as it does. For programs that do one thing and end: call it first, and endProgram() last.
VLN_API void goOnInReader();
/// Ends the program, in a child that has gone on without the destructors of libraries' globals: they may wait
/// for threads that are not there.
[[noreturn]] VLN_API void endProgram(int code);

/// Version of the OpenVDB library in use, such as "10.0.1".
VLN_API char const* openvdbVersion();

} // namespace VLN::Interop
