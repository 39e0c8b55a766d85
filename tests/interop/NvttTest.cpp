// Flat files: written whole, used in place, and no damage goes unseen.
#include "Interop/ChannelValues.h"
#include "Interop/FileError.h"
#include "Interop/NvttRead.h"
#include "Interop/NvttWrite.h"
#include "Interop/Slice.h"
#include "Interop/VolumeFile.h"
#include "Reader/NanoVTTBounds.h"
#include "support/FlatVolume.h"
#include "support/TempFolder.h"

#include <gtest/gtest.h>

#include <cstring>
#include <functional>
#include <sys/stat.h>

namespace VLN::Test {
namespace {

using namespace Interop;
using nanovtt::AlignedHostBuffer;
using nanovtt::NvttFile;
using nanovtt::NvttSectionType;
using Support::FlatVolume;

/// A converted volume with both structures beside it.
struct Converted {
  explicit Converted(int tiles = 400) {
    FlatVolume volume;
    for (int n = 0; n < tiles; ++n) volume.add({n * 4 % 256, n / 64 * 4, n * 7 % 64}, 24, 28);
    volume.finish();
    std::mt19937 random(3);
    for (char const* name : {"a", "b"})
      volume.channel<float>(name, 0.0f, [&](auto const&, int) { return Support::flatValue<float>(random); });
    Support::FlatOptions options;
    options.rootLevelLimit = 4, options.traversal = true, options.haloFraction = 1;
    handle = Support::flatten<>(*volume.object, options, &traversal, &neighbors);
  }
  NvttContent content() const {
    return {handle.data(),
            handle.size(),
            traversal.data(),
            traversal.size(),
            neighbors.data(),
            neighbors.size(),
            {}};
  }

  nanovtt::GridHandle<AlignedHostBuffer> handle;
  AlignedHostBuffer traversal, neighbors;
};

std::string refusal(std::string const& path, NvttCheck check = NvttCheck::kTables) {
  try {
    MappedNvtt const file(path, check);
  } catch (FileError const& error) {
    EXPECT_EQ(error.file(), path);
    return error.reason();
  }
  return "";
}

std::uint64_t get64(std::string const& bytes, std::uint64_t at) {
  return nanovtt::load<std::uint64_t>(bytes.data() + at);
}
template <class T> void put(std::string& bytes, std::uint64_t at, T value) {
  nanovtt::store(bytes.data() + at, value);
}
/// Makes the three hashes of the envelope right again.
void repair(std::string& bytes) {
  auto const directory = get64(bytes, 32), pages = get64(bytes, 48);
  auto const count = nanovtt::load<std::uint32_t>(bytes.data() + 40),
             size = nanovtt::load<std::uint32_t>(bytes.data() + 44);
  put(bytes, 96, nanovtt::hash64(bytes.data() + directory, std::uint64_t(count) * size));
  put(bytes, 104, nanovtt::hash64(bytes.data() + pages, get64(bytes, 56) * 8));
  put(bytes, 120, nanovtt::hash64(bytes.data(), 120));
}

TEST(Hash64, RequirementKnownValues) {
  auto const hash = [](std::string const& text) { return nanovtt::hash64(text.data(), text.size()); };
  EXPECT_EQ(hash(""), 0xEF46DB3751D8E999u);
  EXPECT_EQ(hash("a"), 0xD24EC4F1A98C6E5Bu);
  EXPECT_EQ(hash("abc"), 0x44BC2CF5AD770999u);
  EXPECT_EQ(hash("Nobody inspects the spammish repetition"), 0xFBCEA83C8A378BF1u);
}

/// A buffer with one channel, as a volume again.
template <class T> VdbVolume volumeOf(T const& defaultValue) {
  FlatVolume volume;
  for (int n = 0; n < 8; ++n) volume.add({n % 2 * 4, n / 2 % 2 * 4, n / 4 * 4}, 26, 28);
  volume.finish();
  std::mt19937 random(7);
  volume.channel<T>("c", defaultValue, [&](auto const&, int) { return Support::flatValue<T>(random); });
  Support::FlatOptions options;
  options.rootLevelLimit = 2;
  auto const handle = Support::flatten<>(*volume.object, options);
  TempFolder const folder;
  std::string const path = folder / "c.nvtt";
  writeNvtt(path, {handle.data(), handle.size(), nullptr, 0, nullptr, 0});
  auto content = importVolumes(path);
  EXPECT_EQ(content.volumes.size(), 1u);
  return std::move(content.volumes.at(0));
}

// requirement: whatever type a file brings, its values are printed and drawn
template <class T> void expectShown(T const& defaultValue, int components) {
  VdbVolume const volume = volumeOf<T>(defaultValue);
  auto const values = ChannelValues::of(volume, "c");
  ASSERT_TRUE(values);
  EXPECT_EQ(values->components(), components);
  double v[kMostComponents] = {};
  values->at({1, 2, 3}, v);
  EXPECT_FALSE(values->text({1, 2, 3}).empty());
  EXPECT_NO_THROW(drawSlice(volume, "c"));
}

TEST(Nvtt, RegressionEveryTypeIsShown) {
#if VLN_HAS_ELEMENT_INT16
  expectShown<short>(3, 1);
#endif
#if VLN_HAS_ELEMENT_UINT32
  expectShown<unsigned>(3, 1);
#endif
#if VLN_HAS_ELEMENT_FLOAT4
  expectShown<Velorn::Math::float4>({1, 2, 3, 4}, 4);
  double const v[] = {1, 2, 2, 4};
  EXPECT_DOUBLE_EQ(lengthOf(v, 4), 5);
  EXPECT_DOUBLE_EQ(lengthOf(v, 3), 3);
#endif
  expectShown<Velorn::Math::float3>({1, 2, 3}, 3);
  expectShown<int>(3, 1);
}

TEST(Nvtt, RequirementWhatIsWrittenIsReadInPlace) {
  TempFolder const folder;
  Converted const volume;
  std::string const path = folder / "a.nvtt";
  EXPECT_FALSE(isNvttFile(path));
  writeNvtt(path, volume.content());
  EXPECT_EQ(folder.names(), std::vector<std::string>{"a.nvtt"});
  EXPECT_TRUE(isNvttFile(path));

  MappedNvtt const mapped(path, NvttCheck::kPages);
  NvttFile const& file = mapped.file();
  ASSERT_EQ(mapped.bufferLength(), volume.handle.size());
  EXPECT_EQ(std::memcmp(file.buffer(), volume.handle.data(), volume.handle.size()), 0);
  EXPECT_EQ(reinterpret_cast<std::uintptr_t>(file.buffer()) % 4096, 0u);
  EXPECT_EQ(mapped.reader().gridCount(), 2u);
  EXPECT_STREQ(mapped.reader().grid(1).name(), "b");
  EXPECT_EQ(file.version(), 1u);
  EXPECT_TRUE(file.checkPages().ok());

  ASSERT_EQ(file.sectionCount(), 5u);
  auto const section = [&](NvttSectionType type, std::uint32_t index = 0) {
    return file.section(file.find(type, index));
  };
  auto const container = section(NvttSectionType::kContainer);
  EXPECT_EQ(file.data(container), file.buffer());
  EXPECT_EQ(container.length, mapped.reader().container().containerSize());
  for (std::uint32_t n = 0; n < 2; ++n) {
    EXPECT_EQ(file.data(section(NvttSectionType::kGrid, n)), file.buffer() + mapped.reader().gridOffset(n));
    EXPECT_EQ(section(NvttSectionType::kGrid, n).length, mapped.reader().grid(n).gridSize());
  }
  EXPECT_EQ(file.find(NvttSectionType::kGrid, 2), file.sectionCount());
  auto const expectBytes = [&](nanovtt::NvttSection const& s, AlignedHostBuffer const& buffer) {
    ASSERT_EQ(s.length, buffer.size());
    EXPECT_EQ(s.offset % 64, 0u);
    EXPECT_EQ(std::memcmp(file.data(s), buffer.data(), buffer.size()), 0);
  };
  expectBytes(section(NvttSectionType::kTraversal), volume.traversal);
  expectBytes(section(NvttSectionType::kNeighbors), volume.neighbors);
  for (std::uint32_t n = 0; n < file.sectionCount(); ++n) EXPECT_TRUE(file.isIntact(file.section(n))) << n;
}

TEST(Nvtt, RequirementAnyBytesAreTheSameAgain) {
  TempFolder const folder;
  Converted const volume(50);
  writeNvtt(folder / "a.nvtt", volume.content());
  writeNvtt(folder / "b.nvtt", volume.content());
  EXPECT_EQ(readAll(folder / "a.nvtt"), readAll(folder / "b.nvtt"));
}

TEST(Nvtt, BoundaryABufferAlone) {
  TempFolder const folder;
  FlatVolume volume;
  volume.finish();
  auto const handle = Support::flatten<>(*volume.object, {});
  writeNvtt(folder / "a.nvtt", {handle.data(), handle.size()});
  MappedNvtt const mapped(folder / "a.nvtt", NvttCheck::kPages);
  EXPECT_EQ(mapped.file().sectionCount(), 1u);
  EXPECT_EQ(mapped.file().find(NvttSectionType::kTraversal), 1u);
  EXPECT_EQ(mapped.reader().gridCount(), 0u);
}

// Of tiles that are all alike: from the first code to the last.
std::vector<unsigned char> widestBounds(std::uint32_t tiles) {
  std::vector<unsigned char> bytes(nanovtt::boundsBytes(tiles, 8));
  nanovtt::store(bytes.data() + nanovtt::kBoundsTilesOffset, tiles);
  nanovtt::store(bytes.data() + nanovtt::kBoundsBitsOffset, std::uint32_t(8));
  nanovtt::store(bytes.data() + nanovtt::kBoundsLowOffset, -1.0f);
  nanovtt::store(bytes.data() + nanovtt::kBoundsHighOffset, 1.0f);
  for (std::uint32_t n = 0; n < tiles; ++n) bytes[nanovtt::kBoundsRowsOffset + 3 * n + 1] = 255;
  return bytes;
}

TEST(Nvtt, RequirementBoundsLieBesideTheBuffer) {
  TempFolder const folder;
  Converted const volume;
  std::uint32_t const tiles = nanovtt::ContainerReader(volume.handle.data()).tileCount();
  auto bounds = widestBounds(tiles);
  std::string const path = folder / "a.nvtt";
  auto content = volume.content();
  content.bounds.push_back({1, bounds.data(), bounds.size()});
  writeNvtt(path, content);
  MappedNvtt const mapped(path, NvttCheck::kPages);
  EXPECT_EQ(mapped.bounds(0), nullptr);
  ASSERT_NE(mapped.bounds(1), nullptr);
  EXPECT_EQ(std::memcmp(mapped.bounds(1), bounds.data(), bounds.size()), 0);
  EXPECT_EQ(mapped.file().find(NvttSectionType::kTraversal), 3u) << "what was there before lies where it lay";

  bounds[0] ^= 1;
  EXPECT_THROW(writeNvtt(path, content), FileError);
  bounds[0] ^= 1;
  content.bounds[0].grid = 2;
  EXPECT_THROW(writeNvtt(path, content), FileError);
}

TEST(Nvtt, NegativeDamagedBounds) {
  TempFolder const folder;
  Converted const volume;
  auto const bounds = widestBounds(nanovtt::ContainerReader(volume.handle.data()).tileCount());
  std::string const path = folder / "a.nvtt";
  auto content = volume.content();
  content.bounds.push_back({0, bounds.data(), bounds.size()});
  writeNvtt(path, content);
  std::uint64_t start = 0;
  {
    MappedNvtt const mapped(path);
    start = mapped.file().section(mapped.file().find(NvttSectionType::kBounds)).offset;
  }
  std::string bytes = readAll(path);
  bytes[start + 50] = static_cast<char>(bytes[start + 50] ^ 4);
  writeAll(path, bytes);
  EXPECT_EQ(refusal(path), "bounds differ from their hash (at byte " + std::to_string(start) + ")");
}

TEST(Nvtt, NegativeNothingIsWrittenForWhatIsNoBuffer) {
  TempFolder const folder;
  std::string const zeros(2 << 20, '\0');
  EXPECT_THROW(writeNvtt(folder / "a.nvtt", {zeros.data(), zeros.size()}), FileError);
  EXPECT_THROW(writeNvtt(folder / "no/such/a.nvtt", Converted(10).content()), FileError);
  EXPECT_TRUE(folder.names().empty());
}

TEST(Nvtt, NegativeOtherFiles) {
  TempFolder const folder;
  EXPECT_NE(refusal(folder / "missing.nvtt"), "");
  EXPECT_EQ(refusal(folder.path()), "not a regular file");
  ASSERT_EQ(mkfifo((folder / "pipe").c_str(), 0600), 0);
  EXPECT_EQ(refusal(folder / "pipe"), "not a regular file");
  writeAll(folder / "empty.nvtt", "");
  EXPECT_EQ(refusal(folder / "empty.nvtt"), "shorter than a header (at byte 0)");
  writeAll(folder / "text.nvtt", std::string(1000, 'x'));
  EXPECT_EQ(refusal(folder / "text.nvtt"), "not a flat file (at byte 0)");
  EXPECT_FALSE(isNvttFile(folder / "text.nvtt"));
}

class DamagedNvtt : public ::testing::Test {
protected:
  DamagedNvtt() {
    Converted const volume(60);
    writeNvtt(folder / "good.nvtt", volume.content());
    good = readAll(folder / "good.nvtt");
  }
  std::string refusalOf(std::string const& bytes, NvttCheck check = NvttCheck::kTables) {
    writeAll(folder / "bad.nvtt", bytes);
    return refusal(folder / "bad.nvtt", check);
  }

  TempFolder folder;
  std::string good;
};

TEST_F(DamagedNvtt, NegativeEveryByteOfTheEnvelope) {
  std::uint64_t const data = get64(good, 72), tables = get64(good, 48) + 8 * get64(good, 56);
  ASSERT_EQ(data, 4096u);
  for (std::uint64_t at = 0; at < tables; ++at) {
    std::string bytes = good;
    bytes[at] = static_cast<char>(bytes[at] ^ 1 << at % 8);
    NvttFile file;
    // In memory: so many files would take their time.
    EXPECT_FALSE(NvttFile::open(bytes.data(), bytes.size(), file).ok()) << at;
  }
}

TEST_F(DamagedNvtt, NegativeDamagedBytesAreLocated) {
  std::mt19937 random(4);
  for (int n = 0; n < 30; ++n) {
    std::string bytes = good;
    std::uint64_t const at = 4096 + random() % (bytes.size() - 4096);
    bytes[at] = static_cast<char>(bytes[at] ^ 0x10);
    std::uint64_t const page = 4096 + (at - 4096) / (1 << 20) * (1 << 20);
    EXPECT_EQ(refusalOf(bytes, NvttCheck::kPages),
              "a page differs from its hash (at byte " + std::to_string(page) + ")")
        << at;
  }
}

TEST_F(DamagedNvtt, NegativeOtherLengths) {
  EXPECT_EQ(refusalOf(good.substr(0, good.size() - 1)), "length of the file (at byte 24)");
  EXPECT_EQ(refusalOf(good + '\0'), "length of the file (at byte 24)");
  EXPECT_EQ(refusalOf(good.substr(0, 128)), "length of the file (at byte 24)");
  EXPECT_EQ(refusalOf(good.substr(0, 127)), "shorter than a header (at byte 127)");
}

// With hashes that are right, as a hostile writer would make them.
TEST_F(DamagedNvtt, NegativeFieldsThatLeadOutOfTheFile) {
  std::uint64_t const huge[] = {good.size() + 1, ~std::uint64_t(0), ~std::uint64_t(0) - 63,
                                std::uint64_t(1) << 63};
  for (std::uint64_t const field : {24, 32, 48, 56, 64, 72, 80, 88})
    for (std::uint64_t const value : huge) {
      std::string bytes = good;
      put(bytes, field, value);
      put(bytes, 120, nanovtt::hash64(bytes.data(), 120));
      NvttFile file;
      EXPECT_FALSE(NvttFile::open(bytes.data(), bytes.size(), file).ok()) << field << ' ' << value;
    }
  for (std::uint64_t const field : {20, 40, 44})
    for (std::uint32_t const value : {0u, 0x7FFFFFFFu, 0xFFFFFFFFu}) {
      std::string bytes = good;
      put(bytes, field, value);
      put(bytes, 120, nanovtt::hash64(bytes.data(), 120));
      NvttFile file;
      bool const ok = NvttFile::open(bytes.data(), bytes.size(), file).ok();
      EXPECT_EQ(ok, field == 20 && value != 0)
          << field << ' ' << value << ": a larger header is none of our business";
    }
  for (std::uint64_t entry = 128; entry < 128 + 5 * 32; entry += 32)
    for (std::uint64_t const field : {8, 16})
      for (std::uint64_t const value : huge) {
        std::string bytes = good;
        put(bytes, entry + field, value);
        repair(bytes);
        NvttFile file;
        EXPECT_FALSE(NvttFile::open(bytes.data(), bytes.size(), file).ok()) << entry + field << ' ' << value;
      }
}

TEST_F(DamagedNvtt, NegativeABufferThatIsNone) {
  std::string bytes = good;
  put(bytes, 4096 + 1048724, std::int32_t(77));
  EXPECT_EQ(refusalOf(bytes), "root depth (at byte " + std::to_string(4096 + 1048724) + ")");
}

TEST_F(DamagedNvtt, RequirementWhatLaterVersionsAddIsSkipped) {
  // A later writer: version 7, a header of 192 bytes, entries of 48, and a section of a type unknown today.
  std::uint64_t const data = get64(good, 72), pageCount = get64(good, 56);
  std::string bytes(192, '\7');
  std::memcpy(bytes.data(), good.data(), 128);
  std::uint64_t const directory = bytes.size();
  for (int n = 0; n < 5; ++n)
    bytes += good.substr(128 + 32 * static_cast<std::size_t>(n), 32) + std::string(16, '\5');
  bytes += std::string("\x63\0\0\0\0\0\0\0", 8) + std::string(40, '\xFF');
  std::uint64_t const pages = bytes.size();
  bytes += good.substr(get64(good, 48), 8 * pageCount);
  bytes.resize(data);
  bytes += good.substr(data);
  put(bytes, 8, std::uint32_t(7));
  put(bytes, 20, std::uint32_t(192));
  put(bytes, 32, directory);
  put(bytes, 40, std::uint32_t(6));
  put(bytes, 44, std::uint32_t(48));
  put(bytes, 48, pages);
  repair(bytes);
  writeAll(folder / "later.nvtt", bytes);
  MappedNvtt const mapped(folder / "later.nvtt", NvttCheck::kPages);
  EXPECT_EQ(mapped.file().version(), 7u);
  EXPECT_EQ(mapped.reader().gridCount(), 2u);
  EXPECT_TRUE(mapped.file().isIntact(mapped.file().section(4)));

  // One that says that this reader will not do.
  put(bytes, 12, std::uint32_t(2));
  repair(bytes);
  EXPECT_EQ(refusalOf(bytes), "needs a later version of the reader (at byte 12)");
}

} // namespace
} // namespace VLN::Test
