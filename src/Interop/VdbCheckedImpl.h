// Reading of .vdb files whose every count and size is looked at before OpenVDB's own readers meet them.
//
//   bytes of the file --> walked through --> nodes made by OpenVDB --> leaves filled in parallel
//
// The walk follows grids of the usual trees in files of today's versions. Whatever else comes, be it damaged
// or only seldom, ends it without a word: such a file is for a child process.
#pragma once

#include "Interop/VdbFileImpl.h"

#include <cstdint>
#include <functional>
#include <optional>

namespace VLN::Interop {

/// The file's content, all of it in memory; nothing where the walk ends, or where more than `memoryBytes`
/// would be needed.
/// @param told Told now and then what share has been read; what it throws ends the reading, and comes out.
VLN_API std::optional<VdbFile> readChecked(std::string const& path, std::uint64_t fileSize,
                                           std::uint64_t memoryBytes,
                                           std::function<void(double)> const& told = {},
                                           LeafMemory leafMemory = LeafMemory::kOwn);

} // namespace VLN::Interop
