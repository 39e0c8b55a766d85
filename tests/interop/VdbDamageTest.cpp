// Damaged .vdb files that OpenVDB itself takes for good ones.
#include "Interop/FileError.h"
#include "Interop/VdbExport.h"
#include "Interop/VdbMake.h"
#include "Interop/VdbTypesImpl.h"
#include "support/TempFolder.h"

#include <gtest/gtest.h>

namespace {

using namespace VLN::Interop;
using namespace VLN::Test;

/// A torus whose file has `from` replaced by `to` in one place.
std::string damagedTorus(TempFolder const& folder, std::string const& from, std::string const& to) {
  std::string const path = folder / "torus.vdb";
  makeTorus(path, kFewestMadeVoxels);
  std::string bytes = readAll(path);
  std::size_t const at = bytes.find(from);
  EXPECT_NE(at, std::string::npos);
  if (at != std::string::npos) bytes.replace(at, from.size(), to);
  writeAll(path, bytes);
  return path;
}

// regression: what lay below such an entry was counted, and neither found nor written again
TEST(VdbDamage, AnEntryOfTheRootThatIsOffTheLatticeIsTold) {
  TempFolder const folder;
  std::string const corner("\x00\xF0\xFF\xFF\x00\xF0\xFF\xFF\x00\xF0\xFF\xFF", 12);
  std::string moved = corner;
  moved[0] = 1;
  auto const content = importVdb(damagedTorus(folder, corner, moved));
  EXPECT_TRUE(content.volumes.empty());
  ASSERT_EQ(content.skipped.size(), 1u);
  EXPECT_NE(content.skipped[0].reason.find("off the lattice"), std::string::npos)
      << content.skipped[0].reason;
}

// regression: a leaf of bools was taken to lie where the file says, and not where its parent has it
TEST(VdbDamage, ALeafThatIsNotInItsParentsPlaceIsTold) {
  TempFolder const folder;
  openvdb::initialize();
  auto const grid = openvdb::BoolGrid::create();
  grid->tree().setValueOn(openvdb::Coord(40, 48, 56), true);
  std::string const path = folder / "bools.vdb";
  openvdb::io::File file(path);
  file.setCompression(openvdb::io::COMPRESS_ACTIVE_MASK);
  file.write(openvdb::GridPtrVec{grid});
  file.close();
  std::string bytes = readAll(path);
  std::size_t const at = bytes.rfind(std::string("\x28\0\0\0\x30\0\0\0\x38\0\0\0", 12));
  ASSERT_NE(at, std::string::npos);
  bytes[at] = 0x20;
  writeAll(path, bytes);
  auto const content = importVdb(path);
  EXPECT_TRUE(content.volumes.empty());
  ASSERT_EQ(content.skipped.size(), 1u);
  EXPECT_NE(content.skipped[0].reason.find("off the lattice"), std::string::npos)
      << content.skipped[0].reason;
}

// regression: such a file could be read, but not written
TEST(VdbDamage, CompressionOfAForeignTypeIsWrittenAnew) {
  TempFolder const folder;
  std::string const name("file_compression\x06\0\0\0", 20);
  auto const content = importVdb(damagedTorus(folder, name + "string", name + "strimg"));
  ASSERT_EQ(content.volumes.size(), 1u);
  exportVdb(content, folder / "again.vdb");
  auto const again = importVdb(folder / "again.vdb");
  ASSERT_EQ(again.volumes.size(), 1u);
  EXPECT_EQ(again.volumes[0].channels.at(0).activeVoxels, content.volumes[0].channels.at(0).activeVoxels);
}

} // namespace
