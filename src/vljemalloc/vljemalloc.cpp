#include "vljemalloc/vljemalloc.h"

#if VLJE_BACKEND_SYSTEM

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <malloc.h>

namespace {

// posix_memalign, unlike aligned_alloc, takes any size.
void* allocate(size_t alignment, size_t size) {
  void* ptr = nullptr;
  if (alignment < sizeof(void*)) alignment = sizeof(void*);
  return posix_memalign(&ptr, alignment, size) == 0 ? ptr : nullptr;
}

} // namespace

void* vlje_aligned_alloc(size_t alignment, size_t size) {
  if (alignment == 0 || (alignment & (alignment - 1)) != 0) return nullptr;
  return allocate(alignment, size);
}

void* vlje_mallocx(size_t size, int flags) {
  const size_t alignment = size_t{1} << (flags & 0x3f);
  constexpr size_t kDefaultAlignment = alignof(max_align_t);
  void* ptr = allocate(alignment < kDefaultAlignment ? kDefaultAlignment : alignment, size);
  if (ptr && (flags & VLJE_ZERO)) std::memset(ptr, 0, size);
  return ptr;
}

size_t vlje_xallocx(void* ptr, size_t, size_t, int) { return malloc_usable_size(ptr); }

void vlje_free(void* ptr) { std::free(ptr); }

int vlje_mallctl(const char*, void*, size_t*, void*, size_t) { return ENOENT; }

void vlje_malloc_stats_print(void (*write)(void*, const char*), void* opaque, const char*) {
  constexpr const char* kText = "no statistics: this build allocates from the C library\n";
  if (write) {
    write(opaque, kText);
  } else {
    std::fputs(kText, stderr);
  }
}

#else // jemalloc in one of its two forms

#include <cstring>

#if VLJE_BACKEND_PREFIXED

// The private copy. Hidden here makes the definitions hidden too: the linker takes the strictest
// visibility that any of its inputs asks for.
#define VLJEI(result, name, ...)                                                                             \
  extern "C" __attribute__((visibility("hidden"))) result vljei_##name(__VA_ARGS__)
VLJEI(void*, malloc, size_t);
VLJEI(void*, aligned_alloc, size_t, size_t);
VLJEI(void*, mallocx, size_t, int);
VLJEI(size_t, xallocx, void*, size_t, size_t, int);
VLJEI(void, free, void*);
VLJEI(int, mallctl, const char*, void*, size_t*, void*, size_t);
VLJEI(void, malloc_stats_print, void (*)(void*, const char*), void*, const char*);
#undef VLJEI
#define VLJE_CALL(name) vljei_##name

namespace {
// Blocks lie at multiples of the largest power of two in the size of their class, and the class of a multiple
// of 64 bytes is one too: the way without an alignment, which is much shorter, gives the same block.
void* allocate(size_t alignment, size_t size) {
  if (alignment == 64 && size != 0 && size % 64 == 0) return vljei_malloc(size);
  return vljei_aligned_alloc(alignment, size);
}
} // namespace

#elif VLJE_BACKEND_LINKED

#include <jemalloc/jemalloc.h>

// Only names that the C library does not have: with those it has, the load order would decide
// whose function is called, and a block could be freed into the wrong heap.
namespace {
void* allocate(size_t alignment, size_t size) {
  if (alignment == 0 || (alignment & (alignment - 1)) != 0) return nullptr;
  return mallocx(size ? size : 1, MALLOCX_ALIGN(alignment));
}
namespace linked {
void free(void* ptr) {
  if (ptr) dallocx(ptr, 0);
}
using ::mallctl;
using ::malloc_stats_print;
using ::mallocx;
using ::xallocx;
} // namespace linked
} // namespace
#define VLJE_CALL(name) linked::name

#else
#error "the build must choose a back end: VLJE_BACKEND_PREFIXED, VLJE_BACKEND_LINKED or VLJE_BACKEND_SYSTEM"
#endif

void* vlje_aligned_alloc(size_t alignment, size_t size) { return allocate(alignment, size); }

void* vlje_mallocx(size_t size, int flags) { return VLJE_CALL(mallocx)(size, flags); }

size_t vlje_xallocx(void* ptr, size_t size, size_t extra, int flags) {
  return VLJE_CALL(xallocx)(ptr, size, extra, flags);
}

void vlje_free(void* ptr) { VLJE_CALL(free)(ptr); }

int vlje_mallctl(const char* name, void* oldp, size_t* oldlenp, void* newp, size_t newlen) {
  // 4096 is jemalloc 5's index for "all arenas".
  if (std::strcmp(name, "arenas.purge") == 0) name = "arena.4096.purge";
  return VLJE_CALL(mallctl)(name, oldp, oldlenp, newp, newlen);
}

void vlje_malloc_stats_print(void (*write)(void*, const char*), void* opaque, const char* options) {
  VLJE_CALL(malloc_stats_print)(write, opaque, options);
}

#endif
