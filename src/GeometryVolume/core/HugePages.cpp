#include "GeometryVolume/core/HugePagesImpl.h"

#include <cerrno>
#include <cstdint>

#include <sys/mman.h>

namespace VLN::Internal {

void preferHugePages(void* block, std::size_t bytes) noexcept {
#ifdef MADV_HUGEPAGE
  constexpr std::uintptr_t kPage = std::uintptr_t(1) << 21;
  if (!block || bytes < 2 * kPage) return;
  auto const at = reinterpret_cast<std::uintptr_t>(block);
  std::uintptr_t const begin = (at + kPage - 1) & ~(kPage - 1), end = (at + bytes) & ~(kPage - 1);
  if (begin >= end) return;
  int const error = errno;
  madvise(static_cast<char*>(block) + (begin - at), end - begin, MADV_HUGEPAGE); // a wish, no more
  errno = error;
#else
  static_cast<void>(block), static_cast<void>(bytes);
#endif
}

} // namespace VLN::Internal
