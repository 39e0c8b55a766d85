#include "GeometryVolume/nanovtt/CopyableCudaDeviceBuffer.h"

#include "GeometryVolume/nanovtt/AlignedHostBuffer.h"
#include "GeometryVolume/nanovtt/CudaRuntimeImpl.h"

#include <cstdlib>
#include <cstring>
#include <limits>
#include <stdexcept>
#include <utility>

// Asks the driver of a machine with two graphics processors for the one that runs CUDA.
extern "C" {
extern VLN_API std::uint32_t NvOptimusEnablementCuda;
std::uint32_t NvOptimusEnablementCuda = 1;
}

namespace nanovtt {

namespace {

constexpr std::uint64_t kAlignment = AlignedHostBuffer::kAlignment;

void* allocatePageable(std::uint64_t bytes) {
  if (bytes > std::numeric_limits<std::size_t>::max() - kAlignment) return nullptr;
  return std::aligned_alloc(kAlignment, (bytes + kAlignment - 1) / kAlignment * kAlignment);
}

} // namespace

CopyableCudaDeviceBuffer::HostAllocator CopyableCudaDeviceBuffer::pageableHost() {
  return {&allocatePageable, &std::free};
}

CopyableCudaDeviceBuffer::HostAllocator CopyableCudaDeviceBuffer::pinnedHost() {
  return {&CudaRuntime::allocatePinned, [](void* block) { CudaRuntime::freePinned(block); }};
}

CopyableCudaDeviceBuffer::CopyableCudaDeviceBuffer(CopyableCudaDeviceBuffer&& other) noexcept
    : mAllocator(other.mAllocator)
    , mSize(std::exchange(other.mSize, 0))
    , mHost(std::move(other.mHost))
    , mDevice(std::move(other.mDevice)) {}

CopyableCudaDeviceBuffer& CopyableCudaDeviceBuffer::operator=(CopyableCudaDeviceBuffer&& other) noexcept {
  if (this != &other) {
    mAllocator = other.mAllocator;
    mSize = std::exchange(other.mSize, 0);
    mHost = std::move(other.mHost);
    mDevice = std::move(other.mDevice);
  }
  return *this;
}

CopyableCudaDeviceBuffer CopyableCudaDeviceBuffer::create(std::uint64_t size,
                                                          CopyableCudaDeviceBuffer const* pool) {
  CopyableCudaDeviceBuffer buffer(pool && pool->mAllocator.allocate ? pool->mAllocator : pageableHost());
  if (size) {
    void* const block = buffer.mAllocator.allocate(size);
    if (!block) throw std::runtime_error("CopyableCudaDeviceBuffer: malloc failed");
    buffer.mHost.reset(static_cast<std::uint8_t*>(block), buffer.mAllocator.free);
    buffer.mSize = size;
  }
  return buffer;
}

void CopyableCudaDeviceBuffer::clear() noexcept {
  mSize = 0;
  mHost.reset();
  mDevice.reset();
}

void CopyableCudaDeviceBuffer::deviceUpload(void* stream, bool sync) {
  if (!mDevice) mDevice = std::shared_ptr<void>(CudaRuntime::allocateDevice(mSize), &CudaRuntime::freeDevice);
  CudaRuntime::upload(mDevice.get(), mHost.get(), mSize, stream, sync);
}

void CopyableCudaDeviceBuffer::deviceDownload(void* stream, bool sync) {
  if (!mDevice) throw std::runtime_error("CopyableCudaDeviceBuffer: nothing was uploaded");
  CudaRuntime::download(mHost.get(), mDevice.get(), mSize, stream, sync);
}

CopyableCudaDeviceBuffer CopyableCudaDeviceBuffer::deepCopy() const {
  CopyableCudaDeviceBuffer copy = create(mSize, this);
  if (mSize) std::memcpy(copy.data(), data(), mSize);
  return copy;
}

} // namespace nanovtt
