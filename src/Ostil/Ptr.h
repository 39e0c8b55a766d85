// Ptr<T>, MutablePtr<T>: the host's shared pointer and its sole-owner form.
//
//   Ptr<T>          [ T* object | ControlBlock* block ]
//   ControlBlock    [ vtable: clone, destroy | atomic int64 use count ]
//
// A use count of 1 means that the holder is the only owner and may write in place.
#pragma once

#include <cassert>
#include <cstddef>
#include <cstdint>
#include <stdexcept>
#include <type_traits>
#include <utility>

namespace Ostil {

/// Counts the owners of one object and knows how to copy and to free it.
class ControlBlock {
public:
  /// Writes a new pair that owns a copy of the object. `held` is the address by which the caller knows the
  /// object (possibly that of a base class); the copy is returned at the same offset in the new object.
  virtual void clone(void const* held, void*& outObject, ControlBlock*& outBlock) const = 0;
  /// Frees the object and this block.
  virtual void destroy() = 0;

  std::int64_t useCount() const { return __atomic_load_n(&m_useCount, __ATOMIC_ACQUIRE); }
  void retain() { __atomic_fetch_add(&m_useCount, 1, __ATOMIC_RELAXED); }
  void release() {
    if (__atomic_fetch_sub(&m_useCount, 1, __ATOMIC_ACQ_REL) == 1) destroy();
  }

protected:
  ControlBlock() = default;
  ControlBlock(ControlBlock const&) = delete;
  ControlBlock& operator=(ControlBlock const&) = delete;
  ~ControlBlock() = default;

private:
  std::int64_t m_useCount = 1; ///< by the compiler's operations: <atomic> is a tenth of what a file reads
};

namespace Internal {

/// Object and block in one allocation.
template <class T> class InplaceBlock final : public ControlBlock {
public:
  template <class... Args>
  explicit InplaceBlock(Args&&... args)
      : m_object(std::forward<Args>(args)...) {}
  T* object() { return &m_object; }

  void clone(void const* held, void*& outObject, ControlBlock*& outBlock) const override {
    if constexpr (std::is_copy_constructible_v<T>) {
      auto* copy = new InplaceBlock(m_object);
      // A class whose copies share parts with their source says here how a clone becomes independent.
      if constexpr (requires(T & object) { object.separateClone(); }) {
        try {
          copy->object()->separateClone();
        } catch (...) {
          delete copy;
          throw;
        }
      }
      auto const offset = static_cast<char const*>(held) - reinterpret_cast<char const*>(&m_object);
      outObject = reinterpret_cast<char*>(copy->object()) + offset;
      outBlock = copy;
    } else {
      throw std::logic_error("Ostil: an object of this class cannot be copied");
    }
  }
  void destroy() override { delete this; }

private:
  T m_object;
};

} // namespace Internal

template <class T> class MutablePtr;

/// Shared pointer of two words.
/// @threads Counts are atomic: copying and dropping is safe from any thread, one Ptr itself is not.
template <class T> class Ptr {
public:
  Ptr() = default;
  Ptr(std::nullptr_t) {}
  /// Takes over one reference that the caller already holds.
  Ptr(T* object, ControlBlock* block)
      : m_object(object)
      , m_block(block) {}

  Ptr(Ptr const& other)
      : Ptr(other.m_object, other.m_block) {
    if (m_block) m_block->retain();
  }
  Ptr(Ptr&& other) noexcept
      : m_object(std::exchange(other.m_object, nullptr))
      , m_block(std::exchange(other.m_block, nullptr)) {}

  template <class U>
  requires std::is_convertible_v<U*, T*> Ptr(Ptr<U> const& other)
      : Ptr(other.get(), other.block()) {
    if (m_block) m_block->retain();
  }
  template <class U>
  requires std::is_convertible_v<U*, T*> Ptr(Ptr<U>&& other)
  noexcept
      : m_object(other.get())
      , m_block(other.block()) {
    other.forget();
  }
  template <class U>
  requires std::is_convertible_v<U*, T*> Ptr(MutablePtr<U>&& other)
  noexcept
      : m_object(other.get())
      , m_block(other.block()) {
    other.forget();
  }

  Ptr& operator=(Ptr other) noexcept {
    swap(other);
    return *this;
  }
  ~Ptr() {
    if (m_block) m_block->release();
  }

  void swap(Ptr& other) noexcept {
    std::swap(m_object, other.m_object);
    std::swap(m_block, other.m_block);
  }
  void reset() { Ptr().swap(*this); }

  T* get() const { return m_object; }
  T* operator->() const { return m_object; }
  std::add_lvalue_reference_t<T> operator*() const requires(!std::is_void_v<T>) { return *m_object; }
  explicit operator bool() const { return m_object != nullptr; }
  bool operator==(Ptr const& other) const { return m_object == other.m_object; }
  bool operator==(std::nullptr_t) const { return m_object == nullptr; }

  /// Number of owners; 0 without a control block.
  std::int64_t useCount() const { return m_block ? m_block->useCount() : 0; }
  bool unique() const { return useCount() == 1; }

  ControlBlock* block() const { return m_block; }
  /// Gives the reference up without dropping it: the caller has taken the pair.
  void forget() { m_object = nullptr, m_block = nullptr; }

private:
  T* m_object = nullptr;
  ControlBlock* m_block = nullptr;
};

/// Sole owner of an object: movable, never shared.
template <class T> class MutablePtr {
public:
  MutablePtr() = default;
  MutablePtr(std::nullptr_t) {}
  /// Takes the pair over when `shared` is the only owner, otherwise owns a clone and drops the reference.
  explicit MutablePtr(Ptr<T> shared) {
    if (!shared) return;
    if (shared.unique()) {
      m_object = shared.get(), m_block = shared.block();
      shared.forget();
      return;
    }
    void* object = nullptr;
    shared.block()->clone(shared.get(), object, m_block);
    m_object = static_cast<T*>(object);
  }
  /// A handle on an object that `shared`'s other owners keep: the one exception to sole ownership, for makers
  /// that have just stored what they made.
  static MutablePtr shareWith(Ptr<T> shared) {
    MutablePtr handle;
    handle.m_object = shared.get(), handle.m_block = shared.block();
    shared.forget();
    return handle;
  }
  MutablePtr(MutablePtr&& other) noexcept
      : m_object(std::exchange(other.m_object, nullptr))
      , m_block(std::exchange(other.m_block, nullptr)) {}
  template <class U>
  requires std::is_convertible_v<U*, T*> MutablePtr(MutablePtr<U>&& other)
  noexcept
      : m_object(other.get())
      , m_block(other.block()) {
    other.forget();
  }
  MutablePtr& operator=(MutablePtr other) noexcept {
    std::swap(m_object, other.m_object);
    std::swap(m_block, other.m_block);
    return *this;
  }
  ~MutablePtr() {
    if (m_block) m_block->release();
  }

  T* get() const { return m_object; }
  T* operator->() const { return m_object; }
  T& operator*() const { return *m_object; }
  explicit operator bool() const { return m_object != nullptr; }
  bool operator==(std::nullptr_t) const { return m_object == nullptr; }

  std::int64_t useCount() const { return m_block ? m_block->useCount() : 0; }
  ControlBlock* block() const { return m_block; }
  void forget() { m_object = nullptr, m_block = nullptr; }

private:
  T* m_object = nullptr;
  ControlBlock* m_block = nullptr;
};

/// Makes a new object on a new control block at use count 1.
template <class T, class... Args> Ptr<T> makePtr(Args&&... args) {
  auto* block = new Internal::InplaceBlock<T>(std::forward<Args>(args)...);
  return Ptr<T>(block->object(), block);
}
template <class T, class... Args> MutablePtr<T> makeMutable(Args&&... args) {
  return MutablePtr<T>(makePtr<T>(std::forward<Args>(args)...));
}

/// The same object under another static type, unchecked (also from Ptr<void>).
template <class T, class U> Ptr<T> staticCast(Ptr<U> const& from) {
  if (from.block()) from.block()->retain();
  return Ptr<T>(static_cast<T*>(from.get()), from.block());
}
/// The same object as a `T`; null when it is none.
template <class T, class U> Ptr<T> dynamicCast(Ptr<U> const& from) {
  auto* object = dynamic_cast<T*>(from.get());
  if (!object) return nullptr;
  if (from.block()) from.block()->retain();
  return Ptr<T>(object, from.block());
}

} // namespace Ostil
