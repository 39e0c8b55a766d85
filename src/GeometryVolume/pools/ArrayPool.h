// ArrayPool: recycles arrays, and keeps a wanted amount of physical memory free.
//
// The pool keeps a reference on every array that it hands out: an array returns to it when its last outside
// holder lets go. One store for each element type; everything in it that only the pool holds is idle.
#pragma once

#include "GeometryVolume/core/Export.h"
#include "Ostil/Array.h"
#include "Ostil/Ptr.h"

#include <cstdint>

/// @threads Any thread. One recursive lock guards the pool; what may reach into the pool of channels takes
/// that pool's lock too, after this one.
/// @units All amounts are bytes.
namespace VLN::TileTree3D::ArrayPool {

/// An array of `elementCount` times `defaultValue` that nobody else holds: of the idle arrays one with that
/// capacity, else the smallest larger one, else the largest smaller one, grown; else a new one. Capacities
/// grow to a power of two. Exists for the enabled element types.
/// @edges Null while the pool is off. When the required size cannot be kept free, the array has no spare
/// capacity and does not return to the pool.
/// @error What the array throws when there is no memory.
template <class T> VLN_API Ostil::Ptr<Ostil::Array<T>> allocate(T defaultValue, std::uint64_t elementCount);

/// Off at load.
VLN_API void enable();
/// Lets go of all arrays first.
VLN_API void disable();
VLN_API bool enabled();
/// Tells on standard output what the pool does; docs/memory.md explains the lines.
VLN_API void enableLog();
VLN_API void disableLog();

/// Drops idle arrays, smallest first, until that much more physical memory is free; then asks the pool of
/// channels.
VLN_API void freeMemory(std::uint64_t bytes);
/// Drops every array whose latest hand-out was before `count`, idle or not: one in use stays with its holders
/// and does not return.
VLN_API void freeMemoryNotUsedSinceCount(std::uint64_t count);
/// Drops every array, idle or not.
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

/// Capacity of all arrays, idle or not; 0 while the pool is off.
/// @pre Holders of arrays do not resize them meanwhile.
VLN_API std::uint64_t allocatedMemory();
/// Free physical memory and what idle arrays hold, less the required size when that is on; 0 while the pool
/// is off.
VLN_API std::uint64_t availableMemory();
/// 0 when the system does not tell.
/// @threads Lock-free.
VLN_API std::uint64_t availablePhysicalMemory();
VLN_API std::uint64_t totalPhysicalMemory();
/// The pool's clock: advances with each array handed out. 0 while the pool is off.
VLN_API std::uint64_t allocationCount();
/// Sets the clock to 0 and forgets when arrays were handed out; the arrays stay.
VLN_API void resetAllocationCount();
/// Number of idle arrays; 0 while the pool is off.
VLN_API std::uint64_t freeStoreSize();
/// Number of arrays in use; 0 while the pool is off.
VLN_API std::uint64_t usedStoreSize();
/// Writes what the pool holds to standard output; nothing while the pool is off.
/// @threads Holders may change their arrays meanwhile: one in use is listed as it was handed out.
VLN_API void dump();

/// Capacity that a new or grown array for `elementCount` elements gets: a power of two.
/// @formula pow(2, ceil(log(n) * (1 / log(2)))) in float
/// @numeric Above 2^21 the rounding of float can give a capacity below the count.
VLN_API std::uint64_t capacityFor(std::uint64_t elementCount);

} // namespace VLN::TileTree3D::ArrayPool
