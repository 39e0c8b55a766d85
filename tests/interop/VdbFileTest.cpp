// Files that are not what they claim to be: each ends in a FileError, never in a crash, a hang or a heap of
// memory.
#include "Interop/FileError.h"
#include "Interop/VdbFileImpl.h"
#include "Interop/VdbImport.h"
#include "Interop/VdbMake.h"
#include "support/TempFolder.h"

#include <gtest/gtest.h>

#include <chrono>
#include <cstdlib>
#include <random>

#include <sys/stat.h>

namespace {

using namespace VLN::Interop;
using namespace VLN::Test;

// What reading a file ends in: empty when it is read, else the reason.
std::string outcome(std::string const& path, VdbReadLimits const& limits = {}) {
  try {
    readVdbFile(path, limits);
    return {};
  } catch (FileError const& error) {
    EXPECT_EQ(error.file(), path);
    EXPECT_EQ(error.what(), path + ": " + error.reason());
    EXPECT_EQ(oneLine(error.what(), 1000), error.what());
    EXPECT_FALSE(error.reason().empty());
    return error.reason();
  }
}

class VdbFileTest : public testing::Test {
protected:
  // A small fog volume and a level set with tiles, points and metadata in one file.
  std::string madeFile() {
    openvdb::initialize();
    auto fog = openvdb::FloatGrid::create(0.0f);
    std::mt19937 random(3);
    for (int n = 0; n < 3000; ++n)
      fog->tree().setValueOn(openvdb::Coord(int(random() % 60) - 30, int(random() % 40), int(random() % 20)),
                             float(random() % 1000) / 1000);
    fog->fill(openvdb::CoordBBox(openvdb::Coord(64), openvdb::Coord(127)), 0.5f);
    fog->setName("density");
    fog->insertMeta("author", openvdb::StringMetadata("a test"));
    auto vectors = openvdb::Vec3SGrid::create(openvdb::Vec3f(0));
    for (int n = 0; n < 200; ++n)
      vectors->tree().setValueOn(openvdb::Coord(n % 7, n / 7, 3), openvdb::Vec3f(float(n), 1, 2));
    vectors->setName("velocity");
    std::string const path = m_folder / "made.vdb";
    openvdb::io::File file(path);
    file.write(openvdb::GridPtrVec{fog, vectors});
    file.close();
    return path;
  }

  TempFolder m_folder;
};

// requirement
TEST_F(VdbFileTest, ReadsAllGridsInTheOrderOfTheFile) {
  VdbFile const file = readVdbFile(madeFile());
  ASSERT_EQ(file.grids.size(), 2u);
  EXPECT_EQ(file.grids[0]->getName(), "density");
  EXPECT_EQ(file.grids[1]->getName(), "velocity");
  EXPECT_TRUE(file.metadata);
}

// boundary
TEST_F(VdbFileTest, NamesWhatIsWrongWithWhatIsNoFile) {
  EXPECT_EQ(outcome(m_folder / "missing.vdb"), "No such file or directory");
  EXPECT_EQ(outcome(m_folder.path()), "is a directory");
  std::string const pipe = m_folder / "pipe.vdb";
  ASSERT_EQ(mkfifo(pipe.c_str(), 0600), 0);
  EXPECT_EQ(outcome(pipe), "is not a regular file");
  EXPECT_EQ(outcome("/dev/null"), "is not a regular file");
}

// boundary
TEST_F(VdbFileTest, NamesWhatIsWrongWithForeignFiles) {
  std::string const path = m_folder / "foreign.vdb";
  writeAll(path, "");
  EXPECT_EQ(outcome(path), "is empty");
  writeAll(path, "\x89PNG\r\n\x1a\n and more");
  EXPECT_EQ(outcome(path), "is not an OpenVDB file");
  writeAll(path, "x");
  EXPECT_EQ(outcome(path), "is not an OpenVDB file");
  writeAll(path, " BDV");
  EXPECT_EQ(outcome(path), "is truncated");
  writeAll(path, std::string(" BDV\0\0\0\0", 8) + "this is not how it goes on");
  EXPECT_NE(outcome(path), "");
  std::string noise = std::string(" BDV\0\0\0\0", 8);
  std::mt19937 random(1);
  for (int n = 0; n < 4000; ++n) noise += static_cast<char>(random());
  writeAll(path, noise);
  EXPECT_NE(outcome(path), "");
}

// negative: every shorter file is refused, wherever the cut falls
TEST_F(VdbFileTest, RefusesATruncatedFileOfAnyLength) {
  std::string const whole = readAll(madeFile());
  std::string const path = m_folder / "cut.vdb";
  std::vector<std::size_t> lengths;
  for (std::size_t n = 0; n < 120; ++n) lengths.push_back(n * 13);
  std::mt19937 random(20);
  for (int n = 0; n < 60; ++n) lengths.push_back(random() % whole.size());
  lengths.push_back(whole.size() - 1);
  for (std::size_t length : lengths) {
    if (length >= whole.size()) continue;
    writeAll(path, whole.substr(0, length));
    EXPECT_NE(outcome(path), "") << "cut to " << length << " of " << whole.size() << " bytes";
  }
  writeAll(path, whole);
  EXPECT_EQ(outcome(path), "");
}

// negative: a flipped byte may go unnoticed (values carry no checksum), but reading ends, and ends well
TEST_F(VdbFileTest, SurvivesFlippedBytes) {
  std::string const whole = readAll(madeFile());
  std::string const path = m_folder / "flipped.vdb";
  VdbReadLimits const limits{512u << 20, 5};
  int refused = 0;
  for (unsigned seed = 0; seed < 200; ++seed) {
    std::mt19937 random(seed);
    std::string bytes = whole;
    // Half of the cases hit the first kilobytes, where the structure is.
    std::size_t const reach = seed % 2 ? whole.size() : std::min<std::size_t>(whole.size(), 3000);
    for (unsigned n = 0; n <= seed % 4; ++n)
      bytes[8 + random() % (reach - 8)] ^= static_cast<char>(1 + random() % 255);
    writeAll(path, bytes);
    auto const begin = std::chrono::steady_clock::now();
    refused += !outcome(path, limits).empty();
    EXPECT_LT(std::chrono::steady_clock::now() - begin, std::chrono::seconds(60)) << "seed " << seed;
  }
  EXPECT_GT(refused, 20);
}

// Damages a file the way that `seed` says.
std::string damaged(std::string bytes, unsigned seed) {
  std::mt19937 random(seed);
  auto const byte = [&] { return static_cast<char>(random()); };
  // Half of the cases hit the first kilobytes, where the structure is.
  std::size_t const reach = seed % 2 ? bytes.size() : std::min<std::size_t>(bytes.size(), 4000);
  std::size_t const at = 8 + random() % (reach - 8);
  switch (seed / 2 % 4) {
  case 0: // a few bits
    for (unsigned n = 0; n <= random() % 4; ++n)
      bytes[8 + random() % (reach - 8)] ^= static_cast<char>(1 << random() % 8);
    break;
  case 1: // a run of bytes
    for (std::size_t n = at; n < std::min(at + 1 + random() % 64, bytes.size()); ++n) bytes[n] = byte();
    break;
  case 2: // a count or an offset that is huge, or negative
    for (std::size_t n = at; n < std::min(at + 8, bytes.size()); ++n)
      bytes[n] = random() % 4 ? '\xff' : '\x7f';
    break;
  default: // a piece cut out, or doubled
    std::size_t const length = std::min<std::size_t>(1 + random() % 200, bytes.size() - at);
    bytes = seed % 8 < 4 ? bytes.erase(at, length) : bytes.insert(at, bytes.substr(at, length));
  }
  return bytes;
}

// negative: whatever is done to a real file, importing it ends, with one line if it fails
TEST_F(VdbFileTest, SurvivesThousandsOfDamagedFiles) {
#ifdef __SANITIZE_ADDRESS__
  unsigned cases = 240; // a child process of a sanitized program takes ten times as long
#else
  unsigned cases = 3000;
#endif
  if (char const* const asked = std::getenv("VLN_TEST_DAMAGED_FILES")) cases = unsigned(std::stoul(asked));
  std::vector<std::string> wholes{readAll(madeFile())};
  for (char const* name : {"vdb/sphereCd.vdb", "vdb/sphere_points.vdb"})
    if (std::string const real = dataFile(name); !real.empty()) wholes.push_back(readAll(real));
  std::string const path = m_folder / "damaged.vdb";
  VdbReadLimits const limits{512u << 20, 5};
  unsigned refused = 0;
  for (unsigned seed = 0; seed < cases; ++seed) {
    writeAll(path, damaged(wholes[seed % wholes.size()], seed));
    auto const begin = std::chrono::steady_clock::now();
    try {
      importVdb(path, limits);
    } catch (FileError const& error) {
      ++refused;
      EXPECT_EQ(error.file(), path);
      EXPECT_EQ(oneLine(error.what(), 1000), error.what()) << "seed " << seed;
    }
    EXPECT_LT(std::chrono::steady_clock::now() - begin, std::chrono::seconds(60)) << "seed " << seed;
  }
  RecordProperty("cases", int(cases));
  RecordProperty("refused", int(refused));
  EXPECT_GT(refused, cases / 4);
  EXPECT_LT(refused, cases);
}

// negative
TEST_F(VdbFileTest, BoundsMemory) {
  openvdb::initialize();
  auto grid = openvdb::FloatGrid::create(0.0f);
  for (int n = 0; n < 2000; ++n) grid->tree().setValueOn(openvdb::Coord(8 * n, 0, 0), 1.0f);
  // Each of these branches takes more than 200 kB in memory and next to nothing in the file.
  for (int n = 0; n < 300; ++n) grid->tree().setValueOn(openvdb::Coord(4096 * n, 8192, 0), 1.0f);
  std::string const path = m_folder / "sparse.vdb";
  openvdb::io::File(path).write(openvdb::GridPtrVec{grid});
  EXPECT_EQ(outcome(path, {20u << 20, 20}), "is damaged, or needs more than 20 MB of memory");
  EXPECT_EQ(outcome(path, {400u << 20, 20}), "");
}

// negative
TEST_F(VdbFileTest, ForeignTextStaysOnOneLine) {
  EXPECT_EQ(oneLine("a\nb\tc\x01\xff"), "a b c\\x01\\xff");
  EXPECT_EQ(oneLine("D\u00fcse \u96f2 \U0001f32b"), "D\u00fcse \u96f2 \U0001f32b");
  EXPECT_EQ(oneLine("\x1b[31m \x7f \xc2\x85 \xc0\xaf \xed\xa0\x80 \xe9"),
            "\\x1b[31m \\x7f \\xc2\\x85 \\xc0\\xaf \\xed\\xa0\\x80 \\xe9");
  EXPECT_EQ(oneLine("\u00e4\u00f6\u00fc", 2), "\u00e4\u00f6...");
  EXPECT_EQ(oneLine("abcdef", 3), "abc...");
}

} // namespace
