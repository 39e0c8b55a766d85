// What the commands share about the content of a file.
#pragma once

#include "Interop/VdbImport.h"

#include <cstdint>
#include <string>

namespace Vln {

/// The volume that holds a channel.
/// @error FileError that names the channels there are, or why the grid was skipped.
VLN::Interop::VdbVolume const& volumeWith(VLN::Interop::VdbImport const& content, std::string const& channel);

/// Bytes of all components, shared ones in full.
struct Memory {
  std::uint64_t used = 0, allocated = 0;
};
Memory memoryOf(VLN::Object const& object);

/// Keeps what a command is done with to the end of the program, when the system takes all its memory back at
/// once. Giving it back tile by tile takes about a tenth of the time of reading it.
void leaveToSystem(VLN::Interop::VdbImport content);

} // namespace Vln
