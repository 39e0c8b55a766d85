// What readers of files that must not be trusted share: a first reading in a child process with bounds.
#pragma once

#include "Interop/VdbFile.h"

#include <functional>
#include <memory>

namespace VLN::Interop {

/// The size of a file that can be read twice.
/// @error FileError for what is missing, empty, or no regular file.
std::uint64_t regularFileSize(std::string const& path);

/// Reads a file, and returns what was read, whatever it is, so that its memory is counted.
using ReadInChild = std::function<std::shared_ptr<void>()>;

/// Runs `read` in a child process whose memory and processor time are bounded.
/// @return The limits in force.
/// @error FileError for whatever `read` throws, for a crash, and over a limit.
VdbReadLimits probeInChild(std::string const& path, VdbReadLimits const& asked, std::uint64_t fileSize,
                           ReadInChild const& read);

/// Why a reading failed, for a FileError; called inside a catch block.
std::string readFailure(std::uint64_t memoryBytes);

} // namespace VLN::Interop
