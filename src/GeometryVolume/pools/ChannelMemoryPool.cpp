// Stands in for the pool: it is never enabled, and its two operations go straight to the allocator.
#include "GeometryVolume/pools/ChannelMemoryPool.h"

#include "GeometryVolume/pools/Jemalloc.h"

namespace VLN::TileTree3D::ChannelMemoryPool {

bool enabled() { return false; }
void* allocate(std::uint64_t bytes) { return allocate_jemalloc(bytes, 1); }
void deallocate(void* block) { deallocate_jemalloc(block); }

} // namespace VLN::TileTree3D::ChannelMemoryPool
