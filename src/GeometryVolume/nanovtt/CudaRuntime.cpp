#include "GeometryVolume/nanovtt/CudaRuntimeImpl.h"

#if !VLN_WITH_CUDA

#include <stdexcept>

namespace nanovtt::CudaRuntime {

namespace {

[[noreturn]] void refuse() {
  throw std::runtime_error("CopyableCudaDeviceBuffer: this build has no CUDA (VLN_WITH_CUDA)");
}

} // namespace

void* allocateDevice(std::uint64_t) { refuse(); }
void freeDevice(void*) noexcept {}
void* allocatePinned(std::uint64_t) { refuse(); }
void freePinned(void*) noexcept {}
void upload(void*, void const*, std::uint64_t, void*, bool) { refuse(); }
void download(void*, void const*, std::uint64_t, void*, bool) { refuse(); }

} // namespace nanovtt::CudaRuntime

#endif
