// CopyableCudaDeviceBuffer: bytes on the host, and a copy of them on a device.
//
// Copies share both blocks, which are counted; deepCopy() makes a host block of its own. The type exists in
// every build: without CUDA it is a host buffer whose uploads are refused.
#pragma once

#include "GeometryVolume/core/Export.h"

#include <cstdint>
#include <memory>

namespace nanovtt {

class VLN_API CopyableCudaDeviceBuffer {
public:
  /// Where host blocks come from. Blocks must be aligned to 32.
  struct HostAllocator {
    /// @edges May answer null: there is no memory.
    void* (*allocate)(std::uint64_t bytes) = nullptr;
    void (*free)(void* block) = nullptr;
  };
  /// Ordinary memory: the default.
  static HostAllocator pageableHost();
  /// Page-locked memory, which uploads faster and which all of the machine must spare. Only on request.
  /// @error std::runtime_error on allocation in a build without CUDA.
  static HostAllocator pinnedHost();

  /// Empty, and ordinary memory for what is created from it.
  CopyableCudaDeviceBuffer() noexcept = default;
  /// Empty, and this allocator for what is created from it.
  explicit CopyableCudaDeviceBuffer(HostAllocator const& allocator) noexcept
      : mAllocator(allocator) {}
  /// Shares the blocks.
  CopyableCudaDeviceBuffer(CopyableCudaDeviceBuffer const&) = default;
  CopyableCudaDeviceBuffer& operator=(CopyableCudaDeviceBuffer const&) = default;
  CopyableCudaDeviceBuffer(CopyableCudaDeviceBuffer&& other) noexcept;
  CopyableCudaDeviceBuffer& operator=(CopyableCudaDeviceBuffer&& other) noexcept;
  ~CopyableCudaDeviceBuffer() = default;

  /// `size` bytes on the host, from the allocator of `pool` where there is one.
  /// @error std::runtime_error when there is no memory.
  static CopyableCudaDeviceBuffer create(std::uint64_t size, CopyableCudaDeviceBuffer const* pool = nullptr);
  /// The same: every block is aligned.
  static CopyableCudaDeviceBuffer createAligned(std::uint64_t size,
                                                CopyableCudaDeviceBuffer const* pool = nullptr) {
    return create(size, pool);
  }

  std::uint8_t* data() { return mHost.get(); }
  std::uint8_t const* data() const { return mHost.get(); }
  /// @edges Null before the first upload.
  void* deviceData() { return mDevice.get(); }
  void const* deviceData() const { return mDevice.get(); }
  /// @units Bytes.
  std::uint64_t size() const { return mSize; }
  bool empty() const { return mSize == 0; }
  /// How many buffers share the host block.
  long useCount() const { return mHost.use_count(); }
  /// Lets go of both blocks, and keeps the allocator.
  void clear() noexcept;

  /// Copies the host's bytes to the device, into a block made by the first upload. `stream` is a
  /// cudaStream_t; with `sync` the call waits for it.
  /// @error std::runtime_error from CUDA, and always in a build without it.
  void deviceUpload(void* stream = nullptr, bool sync = true);
  /// Copies the device's bytes to the host.
  /// @error std::runtime_error from CUDA, when nothing was uploaded, and always in a build without it.
  void deviceDownload(void* stream = nullptr, bool sync = true);

  /// A copy with a host block of its own, and no device block.
  CopyableCudaDeviceBuffer deepCopy() const;

private:
  HostAllocator mAllocator{};
  std::uint64_t mSize = 0;
  std::shared_ptr<std::uint8_t> mHost;
  std::shared_ptr<void> mDevice;
};

} // namespace nanovtt
