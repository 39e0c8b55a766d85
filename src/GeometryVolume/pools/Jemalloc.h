// The library's way to the bulk allocator: 64-byte aligned blocks, cache flush, statistics.
#pragma once

#include "GeometryVolume/core/Export.h"

#include <cstdint>

namespace VLN {

/// Every bulk block starts at, and is padded to, a multiple of this many bytes.
inline constexpr std::uint64_t kBulkAlignment = 64;

/// Bytes that a block for `count` elements takes.
constexpr std::uint64_t bulkBytes(std::uint64_t count, std::uint64_t elementSize) {
  std::uint64_t const bytes = count * elementSize;
  std::uint64_t const rest = bytes % kBulkAlignment;
  return rest == 0 ? bytes : bytes + (kBulkAlignment - rest);
}

/// A 64-byte aligned block for `count` elements, padded to a multiple of 64 bytes.
/// @error Null when there is no memory.
/// @threads Any thread.
VLN_API void* allocate_jemalloc(std::uint64_t count, std::uint64_t elementSize);
/// The same, all bytes zero. Large blocks take memory page by page as they are written.
/// @edges Written at once where the system back end lies behind the bulk allocator.
VLN_API void* allocateZeros_jemalloc(std::uint64_t count, std::uint64_t elementSize);
VLN_API void deallocate_jemalloc(void* block);

/// Gives memory back to the system that is free in all arenas. What threads keep cached stays.
/// @cost Linear in what goes; the system clears it anew for whoever gets it next.
/// @threads Any thread.
VLN_API void jemalloc_purge();

/// Gives memory that threads keep cached back to the system, as far as it can be reached: the caches of the
/// calling thread and of the scheduler's workers, then all arenas. With one thread only its own cache goes.
/// @cost Starts a thread and wakes every worker; for the path where memory is short.
/// @threads Any thread. A call that arrives during another returns at once.
/// @error std::system_error when the thread cannot start.
VLN_API void jemalloc_flushCache();

namespace Internal {

/// Receives statistics text.
class VLN_API jemalloc_stream {
public:
  jemalloc_stream() = default;
  jemalloc_stream(jemalloc_stream const&) {}
  jemalloc_stream& operator=(jemalloc_stream const&) { return *this; }
  virtual ~jemalloc_stream();
  virtual void write(char const* text, std::uint64_t length) = 0;
};

/// Writes the allocator's overall totals, in one piece.
VLN_API void jemalloc_dumpStats(jemalloc_stream& stream);

} // namespace Internal
} // namespace VLN
