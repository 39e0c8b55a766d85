// The bytes of a .vdb file as a fuzzer's input.
//
// The whole way of the product is taken, with its child process where a file is not plainly sound: what
// OpenVDB itself does with damaged bytes ends there. A file is either refused with one line of text, or gives
// volumes that are consistent, and that come back the same when they are written and read again.
#pragma once

#include "GeometryVolume/channels/ChannelBase.h"
#include "GeometryVolume/tiletree/Container.h"
#include "Interop/FileError.h"
#include "Interop/VdbDetails.h"
#include "Interop/VdbExport.h"
#include "support/FuzzCheck.h"
#include "support/TempFolder.h"

#include <cstdint>
#include <cstring>
#include <random>
#include <string>

namespace Support {

class VdbCase {
public:
  VdbCase(std::uint8_t const* data, std::size_t size)
      : m_bytes(reinterpret_cast<char const*>(data), size) {}

  /// @return Whether the file was accepted.
  bool run() const {
    static VLN::Test::TempFolder const folder;
    std::string const path = folder / "case.vdb", again = folder / "again.vdb";
    VLN::Test::writeAll(path, m_bytes);
    VLN::Interop::VdbImport content;
    try {
      content = VLN::Interop::importVdb(path, {kMemory, 2, {}});
    } catch (VLN::Interop::FileError const& error) {
      demand(error.what() == path + ": " + error.reason(), "the message does not name the file");
      demandOneLine(error.reason());
      return false;
    }
    check(content);
    for (auto const& volume : content.volumes) {
      demand(VLN::Interop::detailsOf(volume).size() == volume.channels.size(), "details are missing");
    }
    VLN::Interop::metadataOf(content);
    VLN::Interop::exportVdb(content, again);
    auto const second = VLN::Interop::importVdb(again, {4 * kMemory, 20, {}});
    check(second);
    compare(content, second);
    return true;
  }

  /// Changes a few numbers in place: offsets and counts of the file stay right unless one of them is hit.
  static void mutate(std::uint8_t* data, std::size_t size, unsigned seed) {
    if (size < 16) return;
    std::mt19937 random(seed);
    for (auto times = 1 + random() % 4; times; --times) {
      // Headers, metadata and masks lie in front, and again where a grid begins.
      std::size_t const reach = random() % 2 ? std::min<std::size_t>(size, 1200) : size;
      std::size_t const width = std::size_t(1) << random() % 4, at = random() % reach;
      if (at + width > size) continue;
      std::uint64_t v = 0;
      std::memcpy(&v, data + at, width);
      switch (random() % 8) {
      case 0:
        ++v;
        break;
      case 1:
        --v;
        break;
      case 2:
        v ^= std::uint64_t(1) << random() % (8 * width);
        break;
      case 3:
        v = ~std::uint64_t(0);
        break;
      case 4:
        v = 0;
        break;
      case 5:
        v = random() % 64;
        break;
      case 6:
        v = std::uint64_t(random()) << random() % 32;
        break;
      default: { // what stands elsewhere
        std::size_t const from = random() % size;
        if (from + width <= size) std::memcpy(&v, data + from, width);
      }
      }
      std::memcpy(data + at, &v, width);
    }
  }

private:
  static constexpr std::uint64_t kMemory = 200000000;
  using Tree = VLN::TileTree3D::Container<VLN::TileTree3D::PowerOfTwoTraits>;

  static void check(VLN::Interop::VdbImport const& content) {
    for (auto const& volume : content.volumes) {
      auto const tree = volume.object->component<Tree>(VLN::Interop::kVdbContainerName);
      demand(tree && tree->checkConsistency(false) && tree->checkBranchSizes(false),
             "a tree is not consistent");
      demand(volume.voxelSize > 0, "a voxel size is no size");
      demand(!volume.channels.empty(), "a volume has no channels");
      for (auto const& c : volume.channels) {
        auto const channel = volume.object->component<VLN::TileTree3D::ChannelBase>(c.name);
        demand(bool(channel), "a channel is missing");
        demand(c.activeVoxels >= 0 && !(c.hasRange && c.minimum > c.maximum), "figures of a grid are wrong");
        for (int d = channel->minDepth(); d <= Tree::kMaxDepth; ++d)
          demand(channel->tileCount(d) == tree->tileCount(d) &&
                     channel->elementCount(d) == tree->tileCount(d) * channel->layout().size,
                 "a channel is out of step");
      }
    }
    for (auto const& points : content.points)
      demand(points.object && points.dropped >= 0, "a volume of points is not whole");
  }

  static void compare(VLN::Interop::VdbImport const& a, VLN::Interop::VdbImport const& b) {
    demand(a.volumes.size() == b.volumes.size(), "another number of volumes is read again");
    demand(a.points.size() == b.points.size(), "another number of points grids is read again");
    for (std::size_t n = 0; n < a.volumes.size(); ++n) {
      auto const &one = a.volumes[n].channels, &two = b.volumes[n].channels;
      demand(one.size() == two.size(), "another number of grids is read again");
      for (std::size_t c = 0; c < one.size(); ++c)
        demand(one[c].gridName == two[c].gridName && one[c].type == two[c].type &&
                   one[c].activeVoxels == two[c].activeVoxels && one[c].hasRange == two[c].hasRange &&
                   one[c].minimum == two[c].minimum && one[c].maximum == two[c].maximum,
               "the grid '" + VLN::Interop::oneLine(one[c].gridName) + "' changes");
    }
  }

  std::string m_bytes;
};

} // namespace Support
