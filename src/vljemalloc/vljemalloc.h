// The allocator of bulk data: jemalloc's functions under the prefix vlje_.
//
// The build chooses what lies behind them (CMake's VLN_ALLOCATOR):
//
//   prefixed  a private copy of jemalloc inside the library; malloc of the process is untouched
//   linked    the shared jemalloc, which may thereby also become malloc of the process
//   system    aligned allocation of the C library, without statistics or controls
//
// All three give back aligned blocks, honour the alignment and zero flags, and may be mixed freely
// between threads. Blocks must be freed with vlje_free and never with free.
#pragma once

#include <stddef.h>

#if defined(__GNUC__)
#define VLJE_API __attribute__((visibility("default")))
#else
#define VLJE_API
#endif

/// Flag for vlje_mallocx and vlje_xallocx: align to 2^lg bytes. Aligning to 64 bytes is the flag 6.
#define VLJE_LG_ALIGN(lg) ((int)(lg))
/// Flag for vlje_mallocx and vlje_xallocx: fill new bytes with zero.
#define VLJE_ZERO ((int)0x40)

#ifdef __cplusplus
extern "C" {
#endif

/// Allocates `size` bytes at a multiple of `alignment`.
/// @pre `alignment` is a power of two.
/// @error null when there is no memory or the alignment is not one.
VLJE_API void* vlje_aligned_alloc(size_t alignment, size_t size);

/// Allocates at least `size` bytes; `flags` as above, further bits as in jemalloc.
/// @pre `size` is not 0.
/// @error null when there is no memory.
VLJE_API void* vlje_mallocx(size_t size, int flags);

/// Tries to resize a block in place to at least `size` and at best `size + extra` bytes, and
/// answers the real size afterwards. The block never moves, so a result below `size` says that
/// the block could not grow.
/// @edges The system back end never resizes: it answers the size the block has.
VLJE_API size_t vlje_xallocx(void* ptr, size_t size, size_t extra, int flags);

/// Frees a block; null is allowed.
VLJE_API void vlje_free(void* ptr);

/// Reads and writes a control of jemalloc by name.
/// "arenas.purge", which jemalloc 5 no longer knows, purges all arenas.
/// @error an errno value; ENOENT for an unknown name, and for every name with the system back end.
VLJE_API int vlje_mallctl(const char* name, void* oldp, size_t* oldlenp, void* newp, size_t newlen);

/// Writes the allocator's statistics as text, piece by piece, to `write` (null: standard error).
/// `options` are jemalloc's letters, each of which leaves a section out; null for all sections.
VLJE_API void vlje_malloc_stats_print(void (*write)(void* opaque, const char* text), void* opaque,
                                      const char* options);

#ifdef __cplusplus
}
#endif
