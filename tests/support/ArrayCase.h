// The bytes of .npz and .vti files as a fuzzer's input, read as the program does, in a child process first:
// they are either refused with one line of text, or give volumes that are consistent.
#pragma once

#include "GeometryVolume/tiletree/Container.h"
#include "Interop/ArrayFiles.h"
#include "Interop/FileError.h"
#include "support/FuzzCheck.h"
#include "support/ReadAll.h"
#include "support/TempFolder.h"

#include <cstdint>
#include <string>

namespace Support {

class ArrayCase {
public:
  ArrayCase(std::uint8_t const* data, std::size_t size, char const* suffix)
      : m_bytes(reinterpret_cast<char const*>(data), size)
      , m_suffix(suffix) {}

  /// @return Whether the file was accepted.
  bool run() const {
    using namespace VLN::Interop;
    static VLN::Test::TempFolder const folder;
    std::string const path = folder / ("case" + m_suffix);
    VLN::Test::writeAll(path, m_bytes);
    VdbReadLimits const limits{200000000, 2, {}};
    try {
      auto const content = m_suffix == ".npz" ? importNpz(path, limits) : importVti(path, limits);
      for (auto const& volume : content.volumes) {
        auto const tree = volume.object->component<Tree>(kVdbContainerName);
        demand(tree && tree->checkConsistency(false) && tree->checkBranchSizes(false),
               "a tree is not consistent");
        for (auto const& c : volume.channels) demand(c.activeVoxels >= 0, "figures of a grid are wrong");
      }
    } catch (FileError const& error) {
      demand(error.what() == path + ": " + error.reason(), "the message does not name the file");
      demandOneLine(error.reason());
      return false;
    }
    return true;
  }

private:
  using Tree = VLN::TileTree3D::Container<VLN::TileTree3D::PowerOfTwoTraits>;

  std::string m_bytes, m_suffix;
};

struct NpzCase : ArrayCase {
  NpzCase(std::uint8_t const* data, std::size_t size)
      : ArrayCase(data, size, ".npz") {}
};
struct VtiCase : ArrayCase {
  VtiCase(std::uint8_t const* data, std::size_t size)
      : ArrayCase(data, size, ".vti") {}
};

} // namespace Support
