#include "Interop/VdbPackedLeavesImpl.h"

#include <algorithm>
#include <cstdint>
#include <new>

#include <sys/mman.h>

namespace VLN::Interop {

PackedLeaves::PackedLeaves(std::size_t bytes)
    : m_size(bytes) {
  if (bytes == 0) return;
  void* const block = mmap(nullptr, bytes, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
  if (block == MAP_FAILED) throw std::bad_alloc();
  m_begin = static_cast<char*>(block);
#ifdef MADV_HUGEPAGE
  madvise(block, bytes, MADV_HUGEPAGE); // a wish, no more
#endif
}

PackedLeaves::~PackedLeaves() {
  if (m_begin) munmap(m_begin, m_size);
}

void PackedLeaves::drop(std::size_t bytes) {
  // Whole huge pages: to split one costs more than it gives.
  constexpr std::uintptr_t kPage = std::uintptr_t(1) << 21;
  auto const begin = reinterpret_cast<std::uintptr_t>(m_begin);
  std::uintptr_t const end = bytes >= m_size ? begin + m_size : (begin + bytes) & ~(kPage - 1);
  if (end <= begin + m_dropped) return;
  madvise(m_begin + m_dropped, end - begin - m_dropped, MADV_DONTNEED);
  m_dropped = end - begin;
}

} // namespace VLN::Interop
