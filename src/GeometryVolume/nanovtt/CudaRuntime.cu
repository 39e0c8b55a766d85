#include "GeometryVolume/nanovtt/CudaRuntimeImpl.h"

#include <cuda_runtime_api.h>

#include <stdexcept>
#include <string>

namespace nanovtt::CudaRuntime {

namespace {

void check(cudaError_t error, char const* call) {
  if (error == cudaSuccess) return;
  throw std::runtime_error(std::string("CopyableCudaDeviceBuffer: ") + call + ": " +
                           cudaGetErrorString(error));
}

void copy(void* to, void const* from, std::uint64_t bytes, cudaMemcpyKind kind, void* stream, bool sync) {
  auto const queue = static_cast<cudaStream_t>(stream);
  check(cudaMemcpyAsync(to, from, bytes, kind, queue), "cudaMemcpyAsync");
  if (sync) check(cudaStreamSynchronize(queue), "cudaStreamSynchronize");
}

} // namespace

void* allocateDevice(std::uint64_t bytes) {
  void* block = nullptr;
  check(cudaMalloc(&block, bytes), "cudaMalloc");
  return block;
}

void freeDevice(void* block) noexcept { (void)cudaFree(block); }

void* allocatePinned(std::uint64_t bytes) {
  void* block = nullptr;
  check(cudaMallocHost(&block, bytes), "cudaMallocHost");
  return block;
}

void freePinned(void* block) noexcept { (void)cudaFreeHost(block); }

void upload(void* device, void const* host, std::uint64_t bytes, void* stream, bool sync) {
  copy(device, host, bytes, cudaMemcpyHostToDevice, stream, sync);
}

void download(void* host, void const* device, std::uint64_t bytes, void* stream, bool sync) {
  copy(host, device, bytes, cudaMemcpyDeviceToHost, stream, sync);
}

} // namespace nanovtt::CudaRuntime
