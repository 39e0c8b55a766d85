#include "GeometryVolume/pools/Jemalloc.h"
#include "GeometryVolume/pools/KeptBlocksImpl.h"
#include "vljemalloc/vljemalloc.h"

#include <algorithm>
#include <array>
#include <cstddef>
#include <mutex>
#include <type_traits>
#include <utility>

namespace VLN::Internal {

namespace {

struct Kept {
  void* block = nullptr;
  std::uint64_t bytes = 0;
};

/// The oldest first. Never destroyed: channels that live in statics give their blocks back while the process
/// ends.
class KeptBlocks {
public:
  /// The smallest block of at least `bytes`, of which they take most; else null.
  void* take(std::uint64_t bytes) {
    std::lock_guard const lock(m_mutex);
    auto best = end();
    for (auto kept = begin(); kept != end(); ++kept) {
      bool const fits = kept->bytes >= bytes && bytes >= kept->bytes - kept->bytes / 4;
      if (fits && (best == end() || kept->bytes < best->bytes)) best = kept;
    }
    return best != end() ? remove(best) : nullptr;
  }
  /// @return Whether the block waits from now on.
  bool add(Kept const& kept) {
    if (kept.bytes < kSmallestKept || kept.bytes > kMostKept) return false;
    std::lock_guard const lock(m_mutex);
    while (m_bytes + kept.bytes > kMostKept) vlje_free(remove(begin()));
    m_blocks[m_count++] = kept;
    m_bytes += kept.bytes;
    return true;
  }
  bool clear() {
    std::lock_guard const lock(m_mutex);
    bool const any = m_count > 0;
    while (m_count > 0) vlje_free(remove(begin()));
    return any;
  }

private:
  using Blocks = std::array<Kept, kMostKept / kSmallestKept>;

  Blocks::iterator begin() { return m_blocks.begin(); }
  Blocks::iterator end() { return m_blocks.begin() + static_cast<std::ptrdiff_t>(m_count); }
  void* remove(Blocks::iterator at) {
    void* const block = at->block;
    m_bytes -= at->bytes;
    std::move(at + 1, end(), at);
    --m_count;
    return block;
  }

  std::mutex m_mutex;
  Blocks m_blocks;
  std::size_t m_count = 0;
  std::uint64_t m_bytes = 0;
};

constinit KeptBlocks g_kept;
static_assert(std::is_trivially_destructible_v<KeptBlocks>);

void* takeKept(std::uint64_t bytes) {
  // None of those that wait fits a smaller request.
  return bytes >= kSmallestKept - kSmallestKept / 4 ? g_kept.take(bytes) : nullptr;
}

/// Whether jemalloc lies behind the bulk allocator.
bool hasJemalloc() {
  static bool const found = [] {
    char const* version = nullptr;
    std::size_t length = sizeof(version);
    return vlje_mallctl("version", static_cast<void*>(&version), &length, nullptr, 0) == 0;
  }();
  return found;
}

/// What a block has room for: asked for more than there can be, it stays as it is.
std::uint64_t sizeOf(void* block) { return vlje_xallocx(block, SIZE_MAX, 0, VLJE_LG_ALIGN(6)); }

} // namespace

void* allocateKept(std::uint64_t bytes) noexcept {
  void* const kept = takeKept(bytes);
  return kept ? kept : allocate_jemalloc(bytes, 1);
}

void* allocateZerosKept(std::uint64_t bytes) noexcept {
  vlje_free(takeKept(bytes));
  return allocateZeros_jemalloc(bytes, 1);
}

void deallocateKept(void* block) noexcept {
  if (block && hasJemalloc() && g_kept.add({block, sizeOf(block)})) return;
  vlje_free(block);
}

bool freeKept() noexcept { return g_kept.clear(); }

} // namespace VLN::Internal
