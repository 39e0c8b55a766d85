#include "Interop/VdbPackedLeavesImpl.h"

#include <cstdint>
#include <cstdlib>
#include <new>

#include <sys/mman.h>

namespace VLN::Interop {

namespace {

// Below this it pays that the process has memory at hand which it used before.
constexpr std::size_t kLarge = std::size_t(16) << 20;

} // namespace

PackedLeaves::PackedLeaves(std::size_t bytes)
    : m_size(bytes) {
  if (bytes == 0) return;
  if (bytes < kLarge) {
    m_begin = static_cast<char*>(std::malloc(bytes));
    if (!m_begin) throw std::bad_alloc();
    return;
  }
  void* const block = mmap(nullptr, bytes, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
  if (block == MAP_FAILED) throw std::bad_alloc();
  m_begin = static_cast<char*>(block);
#ifdef MADV_HUGEPAGE
  madvise(block, bytes, MADV_HUGEPAGE); // a wish, no more
#endif
}

PackedLeaves::~PackedLeaves() { dropAll(); }

void PackedLeaves::dropAll() {
  if (m_size >= kLarge)
    munmap(m_begin, m_size);
  else
    std::free(m_begin);
  m_begin = nullptr;
  m_size = 0;
}

void PackedLeaves::drop(std::size_t bytes) {
  if (bytes >= m_size) return dropAll();
  if (m_size < kLarge) return;
  // Whole huge pages: to split one costs more than it gives.
  constexpr std::uintptr_t kPage = std::uintptr_t(1) << 21;
  auto const begin = reinterpret_cast<std::uintptr_t>(m_begin);
  std::uintptr_t const end = (begin + bytes) & ~(kPage - 1);
  if (end <= begin + m_dropped) return;
  madvise(m_begin + m_dropped, end - begin - m_dropped, MADV_DONTNEED);
  m_dropped = end - begin;
}

} // namespace VLN::Interop
