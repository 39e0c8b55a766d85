#include "Content.h"

#include "Interop/FileError.h"

#include <fmt/format.h>

#include <utility>
#include <vector>

namespace Vln {

namespace {

using namespace VLN::Interop;

// Distinct channels of all objects in the file's order.
std::string names(VdbImport const& content) {
  std::string list;
  for (auto const& volume : content.volumes)
    for (auto const& channel : volume.channels) list += (list.empty() ? "" : ", ") + channel.name;
  return list.empty() ? "it has none" : "it has " + list;
}

} // namespace

VdbVolume const& volumeWith(VdbImport const& content, std::string const& channel) {
  for (auto const& volume : content.volumes)
    if (volume.channel(channel)) return volume;
  for (auto const& skipped : content.skipped)
    if (skipped.grid == channel) throw FileError(content.file, "'" + channel + "': " + skipped.reason);
  throw FileError(content.file, "has no channel '" + channel + "'; " + names(content));
}

Memory memoryOf(VLN::Object const& object) {
  Memory memory;
  for (auto const& name : object.componentRange()) {
    Memory one;
    object.component(name)->memUse(one.used, one.allocated, true);
    memory.used += one.used, memory.allocated += one.allocated;
  }
  return memory;
}

void leaveToSystem(VdbImport content) {
  static auto* const left = new std::vector<VdbImport>;
  left->push_back(std::move(content));
}

} // namespace Vln
