#include "GeometryVolume/core/HugePagesImpl.h"

#include <cerrno>
#include <cstdint>

#include <sys/mman.h>
#include <unistd.h>

namespace VLN::Internal {

void preferHugePages(void* block, std::size_t bytes) noexcept {
#ifdef MADV_HUGEPAGE
  constexpr std::uintptr_t kPage = std::uintptr_t(1) << 21;
  if (!block || bytes < 2 * kPage) return;
  auto const at = reinterpret_cast<std::uintptr_t>(block);
  // With the small pages at both ends: a block that is a mapping of its own stays one, which the system moves
  // instead of copying it.
  static auto const small = static_cast<std::uintptr_t>(sysconf(_SC_PAGESIZE));
  std::uintptr_t const begin = at & ~(small - 1), end = (at + bytes + small - 1) & ~(small - 1);
  int const error = errno;
  madvise(static_cast<char*>(block) - (at - begin), end - begin, MADV_HUGEPAGE); // a wish, no more
  errno = error;
#else
  static_cast<void>(block), static_cast<void>(bytes);
#endif
}

} // namespace VLN::Internal
