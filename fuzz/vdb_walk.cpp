// libFuzzer target: the bytes of .vdb files, read in the process itself: no child stands between what the
// walk lets through and OpenVDB's own nodes.
#include "Interop/VdbCheckedImpl.h"
#include "support/FuzzCheck.h"
#include "support/TempFolder.h"
#include "vdb_mutator.h"

#include <openvdb/openvdb.h>

extern "C" int LLVMFuzzerTestOneInput(std::uint8_t const* data, std::size_t size) {
  static VLN::Test::TempFolder const folder;
  static std::string const path = folder / "case.vdb";
  constexpr std::uint64_t kMemory = 50000000;
  VLN::Test::writeAll(path, std::string(reinterpret_cast<char const*>(data), size));
  auto const file = VLN::Interop::readChecked(path, size, kMemory);
  if (!file) return 0;
  for (auto const& grid : file->grids) {
    Support::demand(grid && grid->memUsage() < 4 * kMemory, "a grid takes more memory than it may");
    auto const box = grid->evalActiveVoxelBoundingBox();
    Support::demand(box.empty() == (grid->activeVoxelCount() == 0), "a grid is not whole");
  }
  return 0;
}
