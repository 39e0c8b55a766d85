// Growth and trimming of a tile's element vector.
//
// The standard library's own growth is never used: capacities follow one rule on every platform, and a static
// vector must not grow into the slot of the tile behind it.
#pragma once

#include "GeometryVolume/pools/TileDataAllocator.h"

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <cstring>
#include <stdexcept>
#include <type_traits>
#include <vector> // and iterators' categories, without all of <iterator>

namespace VLN::TileTree3D::Internal {

/// Counts elements that nobody writes. A vector made from such a range is made by no loop at all.
class UnwrittenElements {
public:
  using iterator_category = std::random_access_iterator_tag;
  using value_type = Unwritten;
  using difference_type = std::ptrdiff_t;
  using pointer = void;
  using reference = Unwritten;

  explicit UnwrittenElements(std::ptrdiff_t at)
      : m_at(at) {}
  Unwritten operator*() const { return {}; }
  UnwrittenElements& operator++() {
    ++m_at;
    return *this;
  }
  std::ptrdiff_t operator-(UnwrittenElements const& other) const { return m_at - other.m_at; }
  bool operator==(UnwrittenElements const&) const = default;

private:
  std::ptrdiff_t m_at;
};

/// A vector of `n` elements on an allocator, not written.
template <class T> TileVector<T> unwrittenVector(std::int64_t n, TileDataAllocator<T> const& allocator) {
  return TileVector<T>(UnwrittenElements(0), UnwrittenElements(static_cast<std::ptrdiff_t>(n)), allocator);
}

/// Sets a run of elements, of which `value` may be one.
template <class T> void fillRun(T* p, std::int64_t n, T const& value) {
  // Blocks of a known length become stores of whole registers.
  constexpr std::int64_t kBlock = sizeof(T) < 64 ? 64 / sizeof(T) : 1;
  T const v = value;
  for (; n >= kBlock; n -= kBlock, p += kBlock)
    for (std::int64_t i = 0; i < kBlock; ++i) p[i] = v;
  for (; n > 0; --n) *p++ = v;
}

/// The same for a long run: from its first kilobytes on it is copied. Large copies tell the processor that
/// whole lines are written, so it does not read them first.
template <class T> void fillLongRun(T* p, std::int64_t n, T const& value) {
  static_assert(std::is_trivially_copyable_v<T>);
  constexpr auto kFirst = static_cast<std::int64_t>(sizeof(T) < 4096 ? 4096 / sizeof(T) : 1),
                 kMost = 4 * kFirst;
  std::int64_t done = std::min(n, kFirst);
  fillRun(p, done, value);
  while (done < n) {
    std::int64_t const count = std::min({done, kMost, n - done});
    std::memcpy(static_cast<void*>(p + done), p, static_cast<std::size_t>(count) * sizeof(T));
    done += count;
  }
}

/// Whether a vector on this allocator can take `capacity` further elements without leaving its block.
template <class T> bool hasRoom(TileDataAllocator<T> const& a, std::size_t capacity) {
  return !a.isStatic() || a.used() + static_cast<std::int64_t>(capacity) <= a.limit();
}

/// Puts the elements of `v` into a new buffer, each through the allocator's construct. The allocator keeps
/// its state; a static one whose block has no such room left is replaced by one of default state.
template <class T> void rebuffer(TileVector<T>& v, std::size_t capacity) {
  auto const a = v.get_allocator();
  TileVector<T> fresh(hasRoom(a, capacity) ? a : TileDataAllocator<T>());
  fresh.reserve(capacity);
  for (T& element : v) fresh.emplace_back(element);
  v.swap(fresh);
}

/// Raises the capacity to exactly `wanted`.
/// @error std::length_error beyond the largest size.
template <class T> void reserveVector(TileVector<T>& v, std::size_t wanted) {
  if (wanted > v.max_size()) throw std::length_error("a tile cannot reach this size");
  if (hasRoom(v.get_allocator(), wanted))
    v.reserve(wanted);
  else
    rebuffer(v, wanted);
}

/// Makes room for `wanted` elements in all: by half the capacity, or to what is wanted.
/// @pre `wanted` exceeds the capacity and is at most the largest size.
template <class T> void growCapacity(TileVector<T>& v, std::size_t wanted) {
  std::size_t next = v.capacity() + v.capacity() / 2;
  if (next > v.max_size()) next = v.max_size();
  reserveVector(v, next > wanted ? next : wanted);
}

/// Room for one more element.
/// @error std::length_error when the vector has reached its largest size.
template <class T> void growForPush(TileVector<T>& v) {
  if (v.size() < v.capacity()) return;
  if (v.size() >= v.max_size()) throw std::length_error("a tile has reached its largest size");
  growCapacity(v, v.size() + 1);
}

/// Drops the tail, or appends copies of `value`.
/// @error std::length_error beyond the largest size.
template <class T> void resizeVector(TileVector<T>& v, std::size_t n, T value) {
  if (n > v.max_size()) throw std::length_error("a tile cannot reach this size");
  if (n > v.capacity()) growCapacity(v, n);
  v.resize(n, value);
}

/// Room for `n` elements in all: a static vector that has none moves out of its block.
template <class T> void growOutOfBlock(TileVector<T>& v, std::size_t n) {
  if (n > v.max_size())
    rebuffer(v, n > v.capacity() + v.capacity() / 2 ? n : v.capacity() + v.capacity() / 2);
  else if (n > v.capacity())
    growCapacity(v, n);
}
/// As resizeVector(), for a vector that must grow.
template <class T> void resizeOutOfBlock(TileVector<T>& v, std::size_t n, T value) {
  growOutOfBlock(v, n);
  v.resize(n, value);
}

/// Brings the capacity down to the size, where there is memory for that.
template <class T> void trimVector(TileVector<T>& v) {
  try {
    rebuffer(v, v.size());
  } catch (std::bad_alloc const&) {}
}

} // namespace VLN::TileTree3D::Internal
