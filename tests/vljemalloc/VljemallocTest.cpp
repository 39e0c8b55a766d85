#include "vljemalloc/vljemalloc.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <dlfcn.h>
#include <string>
#include <thread>
#include <vector>

namespace {

const std::string kBackEnd = VLN_TEST_ALLOCATOR;

bool isAligned(const void* ptr, std::uintptr_t alignment) {
  return reinterpret_cast<std::uintptr_t>(ptr) % alignment == 0;
}

std::string statistics(const char* options) {
  std::string text;
  vlje_malloc_stats_print(
      [](void* opaque, const char* piece) { static_cast<std::string*>(opaque)->append(piece); }, &text,
      options);
  return text;
}

std::string moduleOf(const void* address) {
  Dl_info info{};
  return dladdr(address, &info) && info.dli_fname ? info.dli_fname : "";
}

bool hasJemalloc() { return kBackEnd != "system"; }

// jemalloc's own count of bytes in live blocks; -1 without it.
std::int64_t allocatedBytes() {
  std::uint64_t epoch = 1;
  std::size_t length = sizeof(epoch);
  if (vlje_mallctl("epoch", &epoch, &length, &epoch, sizeof(epoch)) != 0) return -1;
  std::size_t bytes = 0;
  length = sizeof(bytes);
  if (vlje_mallctl("stats.allocated", &bytes, &length, nullptr, 0) != 0) return -1;
  return static_cast<std::int64_t>(bytes);
}

} // namespace

// requirement
TEST(Vljemalloc, AlignedAllocGivesWritableAlignedBlocks) {
  for (const std::size_t alignment : {16u, 64u, 256u, 4096u}) {
    for (const std::size_t size : {1u, 64u, 65u, 4096u, 100000u, 5000000u}) {
      void* ptr = vlje_aligned_alloc(alignment, size);
      ASSERT_NE(ptr, nullptr) << alignment << " " << size;
      EXPECT_TRUE(isAligned(ptr, alignment)) << alignment << " " << size;
      std::memset(ptr, 0xa5, size);
      EXPECT_EQ(static_cast<unsigned char*>(ptr)[size - 1], 0xa5);
      vlje_free(ptr);
    }
  }
}

// requirement: whatever the class of the size
TEST(Vljemalloc, AlignedAllocOfWholeLines) {
  std::vector<void*> blocks;
  for (std::size_t size = 64; size <= 80 * 1024; size += 64)
    for (int n = 0; n < 3; ++n) {
      blocks.push_back(vlje_aligned_alloc(64, size));
      ASSERT_NE(blocks.back(), nullptr) << size;
      ASSERT_TRUE(isAligned(blocks.back(), 64)) << size;
      std::memset(blocks.back(), 0x5a, size);
    }
  for (std::size_t size = 64 << 10; size <= 64 << 20; size *= 2)
    for (std::size_t const more : {64, 192, 4096 + 64}) {
      blocks.push_back(vlje_aligned_alloc(64, size + more));
      ASSERT_NE(blocks.back(), nullptr) << size;
      ASSERT_TRUE(isAligned(blocks.back(), 64)) << size;
    }
  for (void* block : blocks) vlje_free(block);
}

// boundary: of no bytes
TEST(Vljemalloc, AlignedAllocOfNothing) {
  void* block = vlje_aligned_alloc(64, 0);
  EXPECT_TRUE(isAligned(block, 64));
  vlje_free(block);
}

// boundary
TEST(Vljemalloc, AlignedAllocSmallestAlignment) {
  void* ptr = vlje_aligned_alloc(1, 3);
  ASSERT_NE(ptr, nullptr);
  std::memset(ptr, 1, 3);
  vlje_free(ptr);
}

// negative
TEST(Vljemalloc, AlignedAllocRefusesWhatIsNoPowerOfTwo) {
  EXPECT_EQ(vlje_aligned_alloc(0, 64), nullptr);
  EXPECT_EQ(vlje_aligned_alloc(48, 64), nullptr);
}

// negative
TEST(Vljemalloc, ImpossibleSizeGivesNull) {
  volatile std::size_t huge = SIZE_MAX / 2;
  EXPECT_EQ(vlje_aligned_alloc(64, huge), nullptr);
  EXPECT_EQ(vlje_mallocx(huge, VLJE_LG_ALIGN(6)), nullptr);
}

// requirement
TEST(Vljemalloc, MallocxHonoursTheAlignmentFlag) {
  for (int lg = 0; lg <= 16; ++lg) {
    std::vector<void*> blocks;
    for (const std::size_t size : {1u, 40u, 1000u, 70000u}) {
      void* ptr = vlje_mallocx(size, VLJE_LG_ALIGN(lg));
      ASSERT_NE(ptr, nullptr);
      EXPECT_TRUE(isAligned(ptr, std::uintptr_t{1} << lg)) << "lg " << lg << " size " << size;
      std::memset(ptr, lg, size);
      blocks.push_back(ptr);
    }
    for (void* ptr : blocks) vlje_free(ptr);
  }
}

// requirement
TEST(Vljemalloc, MallocxHonoursTheZeroFlag) {
  constexpr std::size_t kSize = 3000;
  for (int round = 0; round < 8; ++round) {
    void* ptr = vlje_mallocx(kSize, VLJE_LG_ALIGN(6) | VLJE_ZERO);
    ASSERT_NE(ptr, nullptr);
    const auto* bytes = static_cast<const unsigned char*>(ptr);
    for (std::size_t i = 0; i < kSize; ++i) ASSERT_EQ(bytes[i], 0) << "byte " << i;
    std::memset(ptr, 0xff, kSize); // so that a reused block would show
    vlje_free(ptr);
  }
}

// requirement
TEST(Vljemalloc, XallocxAnswersTheRealSizeAndKeepsTheBlock) {
  constexpr std::size_t kSize = 1 << 20;
  auto* ptr = static_cast<unsigned char*>(vlje_mallocx(kSize, 6));
  ASSERT_NE(ptr, nullptr);
  std::memset(ptr, 0x3c, kSize);
  const std::size_t same = vlje_xallocx(ptr, kSize, 0, 6);
  EXPECT_GE(same, kSize);

  const std::size_t shrunk = vlje_xallocx(ptr, kSize / 4, 0, 6);
  EXPECT_GE(shrunk, kSize / 4);
  EXPECT_LE(shrunk, same);
  if (!hasJemalloc()) { EXPECT_EQ(shrunk, same) << "the C library resizes nothing in place"; }
  for (std::size_t i = 0; i < kSize / 4; ++i) ASSERT_EQ(ptr[i], 0x3c);

  // Growing may or may not work; whatever is answered must be usable.
  const std::size_t grown = vlje_xallocx(ptr, 2 * kSize, 0, 6);
  EXPECT_GE(grown, shrunk);
  std::memset(ptr, 0x5a, grown < kSize / 4 ? grown : kSize / 4);
  vlje_free(ptr);
}

// boundary
TEST(Vljemalloc, EmptyBlocksCanBeFreed) { vlje_free(vlje_aligned_alloc(64, 0)); }

// boundary
TEST(Vljemalloc, FreeOfNullDoesNothing) { vlje_free(nullptr); }

// requirement
TEST(Vljemalloc, BlocksMayBeFreedByAnotherThread) {
  std::vector<void*> blocks(200);
  std::thread([&] {
    for (void*& ptr : blocks) ptr = vlje_aligned_alloc(64, 4096);
  }).join();
  std::thread([&] {
    for (void* ptr : blocks) vlje_free(ptr);
  }).join();
}

// requirement
TEST(Vljemalloc, ControlsAreThoseOfJemallocOrAbsent) {
  const char* version = nullptr;
  std::size_t length = sizeof(version);
  const int rc = vlje_mallctl("version", &version, &length, nullptr, 0);
  if (!hasJemalloc()) {
    EXPECT_EQ(rc, ENOENT);
    EXPECT_EQ(vlje_mallctl("thread.tcache.flush", nullptr, nullptr, nullptr, 0), ENOENT);
    EXPECT_EQ(vlje_mallctl("arenas.purge", nullptr, nullptr, nullptr, 0), ENOENT);
    return;
  }
  ASSERT_EQ(rc, 0);
  ASSERT_NE(version, nullptr);
  EXPECT_EQ(version[0], '5') << version;
  EXPECT_EQ(vlje_mallctl("thread.tcache.flush", nullptr, nullptr, nullptr, 0), 0);
  EXPECT_EQ(vlje_mallctl("arenas.purge", nullptr, nullptr, nullptr, 0), 0);
  EXPECT_EQ(vlje_mallctl("no.such.control", nullptr, nullptr, nullptr, 0), ENOENT);
}

// requirement
TEST(Vljemalloc, StatisticsComeFromJemallocOrSayThatThereAreNone) {
  const std::string text = statistics("gblma");
  if (hasJemalloc()) {
    EXPECT_NE(text.find("jemalloc"), std::string::npos) << text;
    EXPECT_NE(text.find("Allocated"), std::string::npos) << text;
    EXPECT_LT(text.size(), statistics("").size()) << "the options leave sections out";
  } else {
    EXPECT_NE(text.find("no statistics"), std::string::npos) << text;
  }
}

// requirement
TEST(Vljemalloc, BlocksAreCountedByTheVeryJemallocThatIsAsked) {
  if (!hasJemalloc()) GTEST_SKIP() << "this build allocates from the C library";
  constexpr std::int64_t kSize = 64 << 20;
  const std::int64_t before = allocatedBytes();
  ASSERT_GE(before, 0);
  void* ptr = vlje_aligned_alloc(64, kSize);
  const std::int64_t during = allocatedBytes();
  vlje_free(ptr);
  const std::int64_t after = allocatedBytes();
  EXPECT_GE(during - before, kSize);
  EXPECT_LT(after - before, kSize);
}

// requirement
TEST(Vljemalloc, MallocOfTheProcessIsLeftAloneUnlessLinked) {
  if (kBackEnd == "linked") GTEST_SKIP() << "here the load order decides which malloc the process has";
  const std::string mallocModule = moduleOf(dlsym(RTLD_DEFAULT, "malloc"));
  const std::string freeModule = moduleOf(dlsym(RTLD_DEFAULT, "free"));
  for (const std::string& module : {mallocModule, freeModule}) {
    const bool ofTheLibrary = module.find("libc.so") != std::string::npos;
    const bool ofASanitizer =
        module.find("libasan.so") != std::string::npos || module.find("libtsan.so") != std::string::npos;
    EXPECT_TRUE(ofTheLibrary || ofASanitizer) << module;
  }
  if (kBackEnd != "prefixed") return;

  // A large block of the C library must not appear in the private jemalloc.
  constexpr std::int64_t kSize = 64 << 20;
  const std::int64_t before = allocatedBytes();
  void* volatile ptr = std::malloc(kSize);
  auto* object = new std::vector<char>(kSize);
  const std::int64_t during = allocatedBytes();
  delete object;
  std::free(ptr);
  EXPECT_LT(during - before, kSize);
}

// regression: names of the private copy must not be visible to anyone else
TEST(Vljemalloc, NothingOfThePrivateCopyIsExported) {
  if (kBackEnd != "prefixed") GTEST_SKIP() << "no private copy in this build";
  if (moduleOf(reinterpret_cast<void*>(&vlje_mallocx)).find("libGeometryVolume") != std::string::npos) {
    EXPECT_NE(dlsym(RTLD_DEFAULT, "vlje_mallocx"), nullptr);
  }
  for (const char* name : {"mallocx", "mallctl", "malloc_stats_print", "je_malloc", "vljei_malloc",
                           "vljei_mallocx", "vljei_mallctl", "vljei_free"}) {
    EXPECT_EQ(dlsym(RTLD_DEFAULT, name), nullptr) << name;
  }
}
