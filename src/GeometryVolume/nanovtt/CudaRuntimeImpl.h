// The few calls of the CUDA runtime that the library makes. CudaRuntime.cu has them; CudaRuntime.cpp stands
// in where the library is built without CUDA.
#pragma once

#include <cstdint>

namespace nanovtt::CudaRuntime {

// All but the two that free throw std::runtime_error when the runtime refuses.
void* allocateDevice(std::uint64_t bytes);
void freeDevice(void* block) noexcept;
void* allocatePinned(std::uint64_t bytes);
void freePinned(void* block) noexcept;
void upload(void* device, void const* host, std::uint64_t bytes, void* stream, bool sync);
void download(void* host, void const* device, std::uint64_t bytes, void* stream, bool sync);

} // namespace nanovtt::CudaRuntime
