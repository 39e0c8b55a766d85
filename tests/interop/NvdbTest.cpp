// .nvdb files in and out. Damaged ones are met in tests/vln too, by the whole program.
#include "Interop/NvdbFile.h"

#include "Interop/DenseReaderImpl.h"
#include "Interop/FileError.h"
#include "Interop/VdbExport.h"
#include "Interop/VdbMake.h"
#include "Interop/VolumeFile.h"
#include "support/ReadAll.h"
#include "support/TempFolder.h"

#include <gtest/gtest.h>

#include <cstring>
#include <filesystem>
#include <random>

#include <zlib.h>

namespace VLN::Test {
namespace {

using namespace VLN::Interop;

std::string real(std::string const& name) { return std::string(VLN_TEST_DATA_DIR) + "/" + name; }

std::string told(auto const& call) {
  try {
    call();
  } catch (FileError const& error) { return error.reason(); }
  return "";
}

/// All that both hold of a channel is the same.
void expectSame(VdbVolume const& a, VdbVolume const& b, std::string const& nameA, std::string const& nameB) {
  SCOPED_TRACE(nameA);
  auto const *left = a.channel(nameA), *right = b.channel(nameB);
  ASSERT_TRUE(left && right);
  EXPECT_EQ(left->type, right->type);
  EXPECT_EQ(left->activeVoxels, right->activeVoxels);
  EXPECT_EQ(left->minimum, right->minimum);
  EXPECT_EQ(left->maximum, right->maximum);
  auto const readA = DenseReader::of(*a.object, nameA), readB = DenseReader::of(*b.object, nameB);
  ASSERT_TRUE(readA && readB);
  IndexBox box = left->activeBox;
  if (box.empty()) return;
  for (int axis = 0; axis < 3; ++axis) {
    EXPECT_EQ(box.min[axis], right->activeBox.min[axis]);
    EXPECT_EQ(box.max[axis], right->activeBox.max[axis]);
    --box.min[axis], ++box.max[axis];
  }
  std::size_t const bytes = std::size_t(box.max.x - box.min.x) * std::size_t(box.max.y - box.min.y) *
                            std::size_t(readA->scalarBytes * readA->components);
  std::vector<std::byte> sliceA(bytes), sliceB(bytes);
  for (int z = box.min.z; z < box.max.z; ++z) {
    readA->slice(box, z, 28, 0, readA->components, sliceA.data());
    readB->slice(box, z, 28, 0, readB->components, sliceB.data());
    ASSERT_TRUE(sliceA == sliceB) << "z = " << z;
  }
}

TEST(NvdbTest, RequirementAPackedFileHoldsTheSmoke) {
  if (!std::filesystem::exists(real("nvdb/smoke-blosc.nvdb"))) GTEST_SKIP() << "no real input files";
  auto const found = importVolumes(real("nvdb/smoke-blosc.nvdb"));
  auto const wanted = importVdb(real("vdb/smoke.vdb"));
  ASSERT_EQ(found.volumes.size(), 1u);
  ASSERT_EQ(found.volumes[0].channels.size(), 1u);
  EXPECT_EQ(found.volumes[0].channels[0].activeVoxels, 1049275);
  EXPECT_EQ(found.volumes[0].voxelSize, 1);
  expectSame(found.volumes[0], wanted.volumes[0], found.volumes[0].channels[0].name, "density");
}

// Vectors, integers, empty grids, active tiles and level sets among 24 grids; colours with a background.
TEST(NvdbTest, RequirementGridsComeBackAsTheyWent) {
  if (!std::filesystem::exists(real("vdb"))) GTEST_SKIP() << "no real input files";
  TempFolder const folder;
  for (char const* name : {"mantaflow_smoke_0010", "sphereCd", "bunny_ls_128"}) {
    SCOPED_TRACE(name);
    auto const before = importVdb(real("vdb/" + std::string(name) + ".vdb"));
    exportNvdb(before, folder / "a.nvdb");
    EXPECT_TRUE(isNvdbFile(folder / "a.nvdb"));
    auto const after = importVolumes(folder / "a.nvdb");
    ASSERT_EQ(after.volumes.size(), before.volumes.size());
    EXPECT_EQ(after.volumes[0].channels.size(), before.volumes[0].channels.size());
    EXPECT_NEAR(after.volumes[0].voxelSize, before.volumes[0].voxelSize, 1e-12 * before.volumes[0].voxelSize);
    for (auto const& channel : before.volumes[0].channels)
      expectSame(before.volumes[0], after.volumes[0], channel.name, channel.name);
    VdbReadLimits limits;
    limits.channels = before.volumes[0].channels.back().name;
    EXPECT_EQ(importNvdb(folder / "a.nvdb", limits).volumes.at(0).channels.size(), 1u);
  }
}

class NvdbDamageTest : public testing::Test {
protected:
  NvdbDamageTest() {
    makeTorus(m_folder / "torus.vdb", kFewestMadeVoxels);
    m_before = importVdb(m_folder / "torus.vdb");
    exportNvdb(m_before, m_file);
    m_bytes = readAll(m_file);
  }

  TempFolder m_folder;
  std::string m_file = m_folder / "torus.nvdb", m_bytes;
  VdbImport m_before;
};

TEST_F(NvdbDamageTest, RequirementZipIsUnpacked) {
  constexpr std::size_t kHead = 16 + 176;
  std::size_t const head = kHead + std::strlen("surface") + 1;
  std::string const data = m_bytes.substr(head);
  uLongf size = compressBound(data.size());
  std::string packed(size, '\0');
  ASSERT_EQ(compress(reinterpret_cast<Bytef*>(packed.data()), &size,
                     reinterpret_cast<Bytef const*>(data.data()), data.size()),
            Z_OK);
  packed.resize(size);
  std::string bytes = m_bytes.substr(0, head);
  std::uint64_t const length = size, fileSize = size + sizeof length;
  bytes[14] = 1; // the codec
  std::memcpy(bytes.data() + 16 + 8, &fileSize, sizeof fileSize);
  bytes.append(reinterpret_cast<char const*>(&length), sizeof length);
  writeAll(m_file, bytes + packed);
  auto const after = importNvdb(m_file);
  ASSERT_EQ(after.volumes.size(), 1u);
  expectSame(m_before.volumes[0], after.volumes[0], "surface", "surface");
  // The same data twice is two grids of one volume.
  writeAll(m_file, bytes + packed + m_bytes);
  EXPECT_EQ(importNvdb(m_file).volumes.at(0).channels.size(), 2u);
  writeAll(m_file, bytes + packed.substr(0, packed.size() - 9) + "123456789");
  EXPECT_NE(told([&] { importNvdb(m_file); }), "");
}

TEST_F(NvdbDamageTest, NegativeTruncatedFilesAreTold) {
  for (std::size_t const length : {std::size_t(9), std::size_t(100), std::size_t(195), std::size_t(1000),
                                   m_bytes.size() / 2, m_bytes.size() - 1}) {
    writeAll(m_file, m_bytes.substr(0, length));
    std::string const reason = told([&] { importVolumes(m_file); });
    EXPECT_EQ(reason.rfind("is truncated", 0), 0u) << length << ": " << reason;
  }
}

/// Where the parts of the one grid lie.
std::uint64_t number(std::string const& bytes, std::size_t at) {
  std::uint64_t v = 0;
  std::memcpy(&v, bytes.data() + at, sizeof v);
  return v;
}

TEST_F(NvdbDamageTest, NegativeOffsetsThatLeadElsewhereAreTold) {
  constexpr std::size_t kGrid = 16 + 176 + 8, kTree = kGrid + 672;
  std::size_t const root = kTree + number(m_bytes, kTree + 24);
  // The first tile of the root begins behind its 64 bytes of floats: key, then the offset of its child.
  for (std::uint64_t const bad :
       {std::uint64_t(1), ~std::uint64_t(0), std::uint64_t(1) << 63, std::uint64_t(m_bytes.size()),
        std::uint64_t(1) << 40, ~std::uint64_t(31)}) {
    for (std::size_t const at : {kTree + 24, root + 64 + 8}) {
      std::string bytes = m_bytes;
      std::memcpy(bytes.data() + at, &bad, sizeof bad);
      writeAll(m_file, bytes);
      EXPECT_NE(told([&] { importNvdb(m_file); }).find("is damaged"), std::string::npos) << at << " " << bad;
    }
  }
}

// Whatever is in a file: it is read, or refused in one line.
TEST_F(NvdbDamageTest, NegativeGarbledFilesNeverCrash) {
  std::mt19937 random(7);
  int refused = 0;
  for (int n = 0; n < 120; ++n) {
    std::string bytes = m_bytes;
    for (int k = 0; k < 1 + n % 4; ++k) {
      // Half of them in the heads, where all the offsets are.
      std::size_t const reach = n % 2 ? bytes.size() : std::size_t(1100);
      bytes[random() % reach] = static_cast<char>(random());
    }
    writeAll(m_file, bytes);
    std::string const reason = told([&] { importVolumes(m_file); });
    EXPECT_EQ(reason.find('\n'), std::string::npos) << reason;
    refused += !reason.empty();
  }
  EXPECT_GT(refused, 10);
}

} // namespace
} // namespace VLN::Test
