// ChannelPool: recycles whole channels, and keeps a wanted amount of physical memory free.
//
// As ArrayPool, with one store for each kind of channel: 108 for all 18 element types.
//
//   traits          (E,H)   (E,H)   (E,H)         a channel with two halo layers has no store
//   <2,4,0,1>       (4,0)   (5,0)   (4,1)
//   <5,5,0,1>       (5,0)   (6,0)   (5,1)
//
// Every pooled channel is named "channel_pool".
#pragma once

#include "GeometryVolume/channels/Channel.h"
#include "Ostil/Ptr.h"

#include <cstdint>

/// @threads Any thread. One recursive lock guards the pool; what may reach into the pool of arrays takes that
/// pool's lock first.
/// @units All amounts are bytes. The measure of a channel is the second output of its memUse().
namespace VLN::TileTree3D::ChannelPool {

/// A channel that nobody else holds: of the idle ones the best fit by tiles, by the rules of
/// ArrayPool::allocate(); else a new one. A reused channel keeps its tiles, and its tile counts until it is
/// updated: it takes the default value, the flag `callElementConstructor` and the depth range, and with that
/// flag all its elements take the default value. `useStaticAllocation` it keeps as it was made. `tileCount`
/// says how many tiles the channel is going to have: it ranks idle channels and sizes the memory check.
/// `component` is what new depths of a reused channel are filled from; null leaves them empty. Exists for the
/// enabled element types.
/// @edges Null while the pool is off. When the required size cannot be kept free, the channel does not return
/// to the pool.
template <class Traits, class T, int E, int H>
VLN_API Ostil::Ptr<Channel<Traits, T, E, H>> allocate(T defaultValue, bool useStaticAllocation,
                                                      bool callElementConstructor, int minDepth, int depth,
                                                      std::uint64_t tileCount, Component const* component);

/// Off at load.
VLN_API void enable();
/// Lets go of all channels first.
VLN_API void disable();
VLN_API bool enabled();
/// Tells on standard output what the pool does; docs/memory.md explains the lines.
VLN_API void enableLog();
VLN_API void disableLog();

/// Drops idle channels, smallest first, flushing the allocator's caches when that does not show, until that
/// much more physical memory is free; then asks the pool of arrays.
/// @cost A flush starts a thread and wakes every worker.
VLN_API void freeMemory(std::uint64_t bytes);
/// Drops every channel whose latest hand-out was before `count`, idle or not: one in use stays with its
/// holders and does not return.
VLN_API void freeMemoryNotUsedSinceCount(std::uint64_t count);
/// Drops every channel, idle or not.
VLN_API void freeAllMemory();

/// Physical memory to keep free. Has an effect only after enableRequiredFreeSize().
VLN_API void setRequiredFreeSize(std::uint64_t bytes);
VLN_API void addRequiredFreeSize(std::uint64_t bytes);
/// Not below 0.
VLN_API void subtractRequiredFreeSize(std::uint64_t bytes);
/// 0 while the pool is off.
VLN_API std::uint64_t requiredFreeSize();
/// No effect while the pool is off.
VLN_API void enableRequiredFreeSize();
VLN_API void disableRequiredFreeSize();

/// What all channels hold, idle or not; 0 while the pool is off. A channel that is being changed at that
/// moment counts with what it held when it was last measured.
VLN_API std::uint64_t allocatedMemory();
/// Free physical memory and what idle channels hold, less the required size when that is on; 0 while the pool
/// is off.
VLN_API std::uint64_t availableMemory();
/// 0 when the system does not tell.
/// @threads Lock-free.
VLN_API std::uint64_t availablePhysicalMemory();
VLN_API std::uint64_t totalPhysicalMemory();
/// The pool's clock: advances with each channel handed out. 0 while the pool is off.
VLN_API std::uint64_t allocationCount();
/// Sets the clock to 0 and forgets when channels were handed out; the channels stay.
VLN_API void resetAllocationCount();
/// Number of idle channels; 0 while the pool is off.
VLN_API std::uint64_t freeStoreSize();
/// Number of channels in use; 0 while the pool is off.
VLN_API std::uint64_t usedStoreSize();
/// Writes what the pool holds to standard output; nothing while the pool is off.
VLN_API void dump();

} // namespace VLN::TileTree3D::ChannelPool
