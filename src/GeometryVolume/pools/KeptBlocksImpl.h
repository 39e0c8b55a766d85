// Large blocks that wait for their next use. The system clears every page that it hands out, which takes
// longer than to fill it, and the bulk allocator gives large blocks back at once: a channel that is made anew
// in each step of a host would pay for fresh pages every time.
#pragma once

#include <cstdint>

namespace VLN::Internal {

/// Smaller blocks are kept by the bulk allocator itself.
inline constexpr std::uint64_t kSmallestKept = std::uint64_t(8) << 20;
/// Bytes that wait at most, in all.
inline constexpr std::uint64_t kMostKept = std::uint64_t(64) << 20;

/// As allocate_jemalloc(bytes, 1), from the blocks that wait if one fits without much waste.
void* allocateKept(std::uint64_t bytes) noexcept;
/// As allocateZeros_jemalloc(bytes, 1), which takes fresh memory. A block that waits and would fit goes, so
/// that it does not lie idle beside the new one.
void* allocateZerosKept(std::uint64_t bytes) noexcept;
/// Frees a block of the bulk allocator, or lets it wait; then the oldest go to make room for it.
/// @edges Frees it with the system back end: there the C library decides, or a sanitizer that looks for uses
/// of what is freed.
void deallocateKept(void* block) noexcept;
/// Frees what waits.
/// @return Whether there was anything.
bool freeKept() noexcept;

} // namespace VLN::Internal
