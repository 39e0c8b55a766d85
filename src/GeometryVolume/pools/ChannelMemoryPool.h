// ChannelMemoryPool: recycles the big blocks behind static tile storage, while it is enabled.
//
// One SimpleAllocator for the process, made on first use and never destroyed. The flag gates nothing here: it
// is the caller's test.
#pragma once

#include "GeometryVolume/core/Export.h"

#include <cstdint>

/// @threads Any thread.
namespace VLN::TileTree3D::ChannelMemoryPool {

/// Channels take blocks from the pool from now on; off at load.
VLN_API void enable();
/// Channels go to the bulk allocator from now on. The pool keeps what it holds.
/// @edges Blocks that are alive across a switch are freed all the same, yet those that the pool handed out
/// stay in its count of used blocks: switch while no channel has static storage.
VLN_API void disable();
VLN_API bool enabled();

/// As SimpleAllocator's operations of the same names.
VLN_API void* allocate(std::uint64_t bytes);
VLN_API void deallocate(void* block);
VLN_API void enableLog();
VLN_API void disableLog();
VLN_API void setExtra(float extra);
VLN_API std::uint64_t freeStoreSize();
VLN_API std::uint64_t usedStoreSize();
VLN_API std::uint64_t freeStoreAvailableMemory();
VLN_API std::uint64_t allocationCount();
VLN_API void resetAllocationCount();
VLN_API void freeAllMemory();
VLN_API void freeMemoryNotUsedSinceCount(std::uint64_t count);

} // namespace VLN::TileTree3D::ChannelMemoryPool
