// Array<T>: the host's growable array. It doubles its capacity when it is full.
#pragma once

#include <cstdint>
#include <initializer_list>
#include <utility>
#include <vector>

namespace Ostil {

template <class T> class Array {
public:
  using value_type = T;

  Array() = default;
  explicit Array(std::uint64_t count)
      : m_items(count) {}
  Array(std::uint64_t count, T const& value)
      : m_items(count, value) {}
  Array(std::initializer_list<T> items)
      : m_items(items) {}

  std::uint64_t size() const { return m_items.size(); }
  std::uint64_t capacity() const { return m_items.capacity(); }
  bool empty() const { return m_items.empty(); }
  void clear() { m_items.clear(); }

  /// Appends; a full array doubles its capacity, an array without storage gets room for one.
  void append(T item) {
    if (m_items.size() == m_items.capacity()) m_items.reserve(m_items.empty() ? 1 : 2 * m_items.capacity());
    m_items.push_back(std::move(item));
  }
  void push_back(T item) { append(std::move(item)); }
  void removeLast() { m_items.pop_back(); }
  void reserve(std::uint64_t capacity) { m_items.reserve(capacity); }
  /// Added elements are zero.
  void resize(std::uint64_t count) { m_items.resize(count); }
  void resize(std::uint64_t count, T const& value) { m_items.resize(count, value); }
  void swap(Array& other) noexcept { m_items.swap(other.m_items); }

  T& operator[](std::uint64_t i) { return m_items[i]; }
  T const& operator[](std::uint64_t i) const { return m_items[i]; }
  T& back() { return m_items.back(); }
  T const& back() const { return m_items.back(); }
  T* data() { return m_items.data(); }
  T const* data() const { return m_items.data(); }

  auto begin() { return m_items.begin(); }
  auto end() { return m_items.end(); }
  auto begin() const { return m_items.begin(); }
  auto end() const { return m_items.end(); }

  bool operator==(Array const&) const = default;

private:
  std::vector<T> m_items;
};

} // namespace Ostil
