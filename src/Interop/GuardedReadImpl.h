// What readers of files that must not be trusted share: a first reading in a child process with bounds.
#pragma once

#include "Interop/VdbFileImpl.h"

#include <functional>

namespace VLN::Interop {

/// Limits with numbers in place of zeros.
VdbReadLimits effectiveLimits(VdbReadLimits limits, std::uint64_t fileSize);

/// Reads all of a file.
using ReadGrids = std::function<VdbFile()>;

/// Runs `read` in a child process whose memory and processor time are bounded, and drops what it read.
/// @return The limits in force.
/// @error FileError for whatever `read` throws, for a crash, and over a limit.
VdbReadLimits probeInChild(std::string const& path, VdbReadLimits const& asked, std::uint64_t fileSize,
                           ReadGrids const& read);

/// The same, and then what it read: a second time, or, with goOnInReader(), out of the child as which the
/// program goes on.
VdbFile readGuarded(std::string const& path, VdbReadLimits const& asked, std::uint64_t fileSize,
                    ReadGrids const& read);

} // namespace VLN::Interop
