// Atomic<T>: a word that threads share. What the headers of the library need of std::atomic, whose own header
// costs every file that includes them a tenth of what it has to read.
#pragma once

namespace VLN::Internal {

/// An integer or a pointer. Not copied: each has a meaning where it lies.
template <class T> class Atomic {
public:
  constexpr Atomic(T value = T{}) noexcept
      : m_value(value) {}
  Atomic(Atomic const&) = delete;
  Atomic& operator=(Atomic const&) = delete;

  T loadRelaxed() const noexcept { return __atomic_load_n(&m_value, __ATOMIC_RELAXED); }
  T loadAcquire() const noexcept { return __atomic_load_n(&m_value, __ATOMIC_ACQUIRE); }
  void storeRelaxed(T value) noexcept { __atomic_store_n(&m_value, value, __ATOMIC_RELAXED); }
  void storeRelease(T value) noexcept { __atomic_store_n(&m_value, value, __ATOMIC_RELEASE); }
  /// Returns the old value.
  T addRelaxed(T n) noexcept { return __atomic_fetch_add(&m_value, n, __ATOMIC_RELAXED); }
  T addAcquireRelease(T n) noexcept { return __atomic_fetch_add(&m_value, n, __ATOMIC_ACQ_REL); }

private:
  T m_value;
};

} // namespace VLN::Internal
