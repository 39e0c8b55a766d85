// TileDataAllocator<T>: allocator of the element vectors of tiles.
//
// A vector's elements come from the bulk allocator, or, with a static allocator, from a block that its owner
// keeps:
//
//   m_base                    m_base + m_used                     m_base + m_limit
//     |======== handed out =========|............ free .................|
//
// Static storage is carved off by an atomic counter and never given back by the vector.
#pragma once

#include "GeometryVolume/core/detail/Atomic.h"
#include "GeometryVolume/pools/Jemalloc.h"

#include <cstddef>
#include <cstdint>
#include <new>
#include <type_traits>
#include <utility>
#include <vector>

namespace VLN {

/// In place of a value: the element stays as the memory held it.
struct Unwritten {};

template <class T> class TileDataAllocator {
public:
  using value_type = T;
  using size_type = std::size_t;
  using difference_type = std::ptrdiff_t;
  // A vector's buffer and its allocator belong together: they always travel as a pair.
  using propagate_on_container_copy_assignment = std::true_type;
  using propagate_on_container_move_assignment = std::true_type;
  using propagate_on_container_swap = std::true_type;
  using is_always_equal = std::false_type;

  TileDataAllocator() = default;
  /// A static allocator over a block of `limit` elements.
  TileDataAllocator(T* base, std::int64_t limit, bool construct)
      : m_static(true)
      , m_construct(construct)
      , m_base(base)
      , m_limit(limit) {}
  /// Takes its storage from the bulk allocator, and leaves elements unwritten when `construct` is false.
  explicit TileDataAllocator(bool construct)
      : m_construct(construct) {}
  TileDataAllocator(TileDataAllocator const& b) noexcept
      : m_static(b.m_static)
      , m_construct(b.m_construct)
      , m_base(b.m_base)
      , m_used(b.used())
      , m_limit(b.m_limit) {}
  /// A block is typed: another element type starts with the default state.
  template <class U>
  explicit TileDataAllocator(TileDataAllocator<U> const& b) noexcept
      : m_construct(b.constructs()) {}
  TileDataAllocator& operator=(TileDataAllocator const& b) noexcept {
    m_static = b.m_static;
    m_construct = b.m_construct;
    m_base = b.m_base;
    m_used.storeRelaxed(b.used());
    m_limit = b.m_limit;
    return *this;
  }

  /// @error std::bad_alloc when the bulk allocator has no memory. A block is not checked against its limit.
  /// @threads Lock-free: threads may carve from one block at once.
  T* allocate(std::size_t n) {
    if (m_static) {
      // Who takes a whole block shares it with nobody: as for most tiles, and without a locked instruction.
      bool const whole = static_cast<std::int64_t>(n) == m_limit && m_used.loadRelaxed() == 0;
      if (!whole) return m_base + m_used.addRelaxed(static_cast<std::int64_t>(n));
      m_used.storeRelaxed(m_limit);
      return m_base;
    }
    void* const block = allocate_jemalloc(n, sizeof(T));
    if (!block) throw std::bad_alloc();
    return static_cast<T*>(block);
  }
  void deallocate(T* p, std::size_t = 0) noexcept {
    if (!m_static) deallocate_jemalloc(p);
  }
  /// Largest size that a vector on this allocator may reach.
  std::size_t max_size() const noexcept {
    return m_static ? static_cast<std::size_t>(m_limit) : static_cast<std::size_t>(PTRDIFF_MAX) / sizeof(T);
  }
  /// Leaves the element as the memory held it when the construct flag is clear.
  template <class... Args> void construct(T* p, Args&&... args) {
    if (m_construct) ::new (static_cast<void*>(p)) T(std::forward<Args>(args)...);
  }
  void construct(T*, Unwritten) {}

  /// A copied vector owns its storage.
  TileDataAllocator select_on_container_copy_construction() const { return {}; }
  /// Whether storage of one can be given back through the other.
  bool operator==(TileDataAllocator const& b) const noexcept {
    return m_static ? b.m_static && m_base == b.m_base : !b.m_static;
  }

  bool isStatic() const { return m_static; }
  bool constructs() const { return m_construct; }
  T* base() const { return m_base; }
  std::int64_t used() const { return m_used.loadRelaxed(); }
  std::int64_t limit() const { return m_limit; }

private:
  bool m_static = false;
  bool m_construct = true;
  T* m_base = nullptr;
  VLN::Internal::Atomic<std::int64_t> m_used;
  std::int64_t m_limit = 0;
};

/// The elements of one tile.
template <class T> using TileVector = std::vector<T, TileDataAllocator<T>>;

} // namespace VLN
