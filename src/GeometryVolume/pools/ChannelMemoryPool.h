// ChannelMemoryPool: recycles the big blocks behind static tile storage, while it is enabled.
#pragma once

#include "GeometryVolume/core/Export.h"

#include <cstdint>

namespace VLN::TileTree3D::ChannelMemoryPool {

/// Whether channels take their blocks from the pool. Off for as long as the library has no pool.
VLN_API bool enabled();
/// A 64-byte aligned block.
/// @error Null when there is no memory.
VLN_API void* allocate(std::uint64_t bytes);
VLN_API void deallocate(void* block);

} // namespace VLN::TileTree3D::ChannelMemoryPool
