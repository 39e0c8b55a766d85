// Any: a type-erased value behind one manager function.
#pragma once

#include <cstddef>
#include <new>
#include <type_traits>
#include <typeindex>
#include <utility>

namespace Ostil {

/// Holds a value of any copyable type. Small values lie inside the Any, others on the heap.
class Any {
public:
  enum class Request : int {
    kDestroy = 0,
    kCopy = 1,
    kMove = 2,
    kAddressIfType = 3,
    kAddress = 4,
    kType = 5
  };

  Any() noexcept {}
  template <class T>
  requires(!std::is_same_v<std::decay_t<T>, Any> && std::is_copy_constructible_v<std::decay_t<T>>)
      Any(T&& value) {
    using V = std::decay_t<T>;
    if constexpr (kInside<V>)
      ::new (m_storage.bytes) V(std::forward<T>(value));
    else
      m_storage.heap = new V(std::forward<T>(value));
    m_manager = &manage<V>;
  }
  Any(Any const& other) {
    if (other.m_manager) {
      Argument a{this, nullptr};
      other.m_manager(Request::kCopy, const_cast<Any*>(&other), &a);
      m_manager = other.m_manager;
    }
  }
  Any(Any&& other) noexcept { take(other); }
  Any& operator=(Any other) noexcept {
    clear();
    take(other);
    return *this;
  }
  ~Any() { clear(); }

  bool empty() const { return m_manager == nullptr; }
  explicit operator bool() const { return !empty(); }
  void clear() {
    if (!m_manager) return;
    m_manager(Request::kDestroy, this, nullptr);
    m_manager = nullptr;
  }

  /// Type of the held value; that of `void` when empty.
  std::type_index type() const {
    if (!m_manager) return typeid(void);
    Argument a{nullptr, nullptr};
    m_manager(Request::kType, const_cast<Any*>(this), &a);
    return *a.type;
  }

  /// Address of the held value when it is a `T`, else null.
  template <class T> T const* get() const { return const_cast<Any*>(this)->get<T>(); }
  template <class T> T* get() {
    if (!m_manager) return nullptr;
    std::type_info const* asked = &typeid(T);
    Argument a{nullptr, asked};
    return static_cast<T*>(m_manager(Request::kAddressIfType, this, &a));
  }
  /// Address of the held value, whatever its type; null when empty.
  void const* address() const { return const_cast<Any*>(this)->address(); }
  void* address() { return m_manager ? m_manager(Request::kAddress, this, nullptr) : nullptr; }

private:
  struct Argument {
    Any* target;
    std::type_info const* type;
  };
  union Storage {
    void* heap;
    alignas(void*) std::byte bytes[2 * sizeof(void*)];
  };
  using Manager = void* (*)(Request, Any*, Argument*);

  template <class V>
  static constexpr bool kInside = sizeof(V) <= sizeof(Storage) &&
                                  alignof(V) <= alignof(Storage) && std::is_nothrow_move_constructible_v<V>;

  template <class V> V* held() {
    if constexpr (kInside<V>)
      return std::launder(reinterpret_cast<V*>(m_storage.bytes));
    else
      return static_cast<V*>(m_storage.heap);
  }

  template <class V> static void* manage(Request request, Any* self, Argument* a) {
    V* value = self->held<V>();
    switch (request) {
    case Request::kDestroy:
      if constexpr (kInside<V>)
        value->~V();
      else
        delete value;
      break;
    case Request::kCopy:
      if constexpr (kInside<V>)
        ::new (a->target->m_storage.bytes) V(*value);
      else
        a->target->m_storage.heap = new V(*value);
      break;
    case Request::kMove:
      if constexpr (kInside<V>) {
        ::new (a->target->m_storage.bytes) V(std::move(*value));
        value->~V();
      } else {
        a->target->m_storage.heap = self->m_storage.heap;
      }
      break;
    case Request::kAddressIfType:
      return *a->type == typeid(V) ? value : nullptr;
    case Request::kAddress:
      return value;
    case Request::kType:
      a->type = &typeid(V);
      break;
    }
    return nullptr;
  }

  void take(Any& other) noexcept {
    if (!other.m_manager) return;
    Argument a{this, nullptr};
    other.m_manager(Request::kMove, &other, &a);
    m_manager = std::exchange(other.m_manager, nullptr);
  }

  Manager m_manager = nullptr;
  Storage m_storage;
};

} // namespace Ostil
