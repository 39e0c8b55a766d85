#include "GeometryVolume/nanovtt/CopyableCudaDeviceBuffer.h"
#include "GeometryVolume/nanovtt/GridHandle.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <cstring>
#include <stdexcept>
#include <utility>

namespace {

using Buffer = nanovtt::CopyableCudaDeviceBuffer;

TEST(CudaBuffer, RequirementWorksOnTheHost) {
  Buffer none;
  EXPECT_TRUE(none.empty());
  EXPECT_EQ(none.data(), nullptr);
  EXPECT_EQ(none.deviceData(), nullptr);
  auto buffer = Buffer::create(70, &none);
  ASSERT_EQ(buffer.size(), 70u);
  EXPECT_EQ(reinterpret_cast<std::uintptr_t>(buffer.data()) % 32, 0u);
  std::memset(buffer.data(), 5, 70);
  EXPECT_EQ(buffer.deviceData(), nullptr);
  buffer.clear();
  EXPECT_TRUE(buffer.empty());
  EXPECT_EQ(buffer.data(), nullptr);
  EXPECT_TRUE(Buffer::create(0).empty());
}

TEST(CudaBuffer, RequirementCopiesShareAndDeepCopiesDoNot) {
  auto a = Buffer::create(8);
  a.data()[0] = 1;
  Buffer b = a;
  EXPECT_EQ(a.useCount(), 2);
  EXPECT_EQ(a.data(), b.data());
  Buffer const c = a.deepCopy();
  EXPECT_NE(c.data(), a.data());
  EXPECT_EQ(c.useCount(), 1);
  b.data()[0] = 2;
  EXPECT_EQ(a.data()[0], 2);
  EXPECT_EQ(c.data()[0], 1);

  Buffer d(std::move(a));
  EXPECT_TRUE(a.empty()); // NOLINT(bugprone-use-after-move)
  EXPECT_EQ(a.data(), nullptr);
  EXPECT_EQ(d.useCount(), 2);
  b = std::move(d);
  EXPECT_EQ(b.useCount(), 1);
  nanovtt::GridHandle<Buffer> handle(std::move(b));
  EXPECT_EQ(handle.size(), 8u);
  EXPECT_TRUE(Buffer().deepCopy().empty());
}

int live = 0;

TEST(CudaBuffer, RequirementTheCallersAllocatorServesWhatIsCreatedFromIt) {
  Buffer::HostAllocator const counting{[](std::uint64_t bytes) {
                                         ++live;
                                         return std::malloc(bytes);
                                       },
                                       [](void* block) {
                                         --live;
                                         std::free(block);
                                       }};
  Buffer const pool(counting);
  {
    auto const a = Buffer::create(16, &pool);
    auto const b = Buffer::create(16, &a);
    auto const c = b.deepCopy();
    EXPECT_EQ(live, 3);
    auto const plain = Buffer::create(16);
    EXPECT_EQ(live, 3);
  }
  EXPECT_EQ(live, 0);
  Buffer const never({[](std::uint64_t) -> void* { return nullptr; }, &std::free});
  EXPECT_THROW(Buffer::create(16, &never), std::runtime_error);
  EXPECT_THROW(Buffer::create(~0ull), std::runtime_error);
}

// A machine without a device, or a build without CUDA, refuses; with both, the bytes come back.
TEST(CudaBuffer, RequirementUploadsOrSaysWhyNot) {
  auto buffer = Buffer::create(64);
  std::memset(buffer.data(), 42, 64);
  EXPECT_THROW(buffer.deviceDownload(), std::runtime_error) << "nothing is there yet";
  try {
    buffer.deviceUpload();
  } catch (std::runtime_error const& error) {
    EXPECT_EQ(std::strncmp(error.what(), "CopyableCudaDeviceBuffer: ", 26), 0) << error.what();
    EXPECT_EQ(buffer.deviceData(), nullptr);
    EXPECT_EQ(buffer.data()[63], 42) << "the host's bytes stay";
    return;
  }
  std::memset(buffer.data(), 0, 64);
  buffer.deviceDownload();
  EXPECT_EQ(buffer.data()[63], 42);
}

} // namespace
