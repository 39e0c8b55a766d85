// AlignedHostBuffer: a range of bytes from a shared pool.
//
//   Pool::mData                    mFree                     mData + mSize
//     │ buffer │ pad │ buffer │ ... │ free                       │
//
// A pool hands out space by moving mFree on, and takes nothing back: space returns when the pool goes, with
// the last buffer that shares it.
#pragma once

#include "GeometryVolume/core/Export.h"

#include <cstdint>
#include <memory>
#include <mutex>
#include <unordered_set>

namespace nanovtt {

class VLN_API AlignedHostBuffer {
public:
  class Pool;

  /// What a managed pool's block, and so the first buffer of each pool, is aligned to.
  static constexpr std::uint64_t kAlignment = 32;

  /// Empty.
  AlignedHostBuffer() noexcept = default;
  AlignedHostBuffer(AlignedHostBuffer&& other) noexcept;
  AlignedHostBuffer& operator=(AlignedHostBuffer&& other) noexcept;
  AlignedHostBuffer(AlignedHostBuffer const&) = delete;
  AlignedHostBuffer& operator=(AlignedHostBuffer const&) = delete;
  ~AlignedHostBuffer() { clear(); }

  /// `size` bytes from the pool that `pool` belongs to, or from a new pool of exactly that size.
  /// @edges The start is aligned only if all sizes drawn from the pool before were multiples of 32.
  /// @error std::runtime_error when the pool has too little left, or no memory is to be had.
  static AlignedHostBuffer create(std::uint64_t size, AlignedHostBuffer const* pool = nullptr);
  /// As create(), and aligned to 32: skips 1 to 31 bytes of the pool first where that is needed and still
  /// leaves room for `size`.
  static AlignedHostBuffer createAligned(std::uint64_t size, AlignedHostBuffer const* pool = nullptr);
  /// A buffer of no bytes that belongs to a new pool, for create() to draw from. With `block` null the pool
  /// allocates its own; otherwise the block stays the caller's and must outlive every buffer of the pool.
  static AlignedHostBuffer createPool(std::uint64_t size, void* block = nullptr);

  std::uint8_t* data() { return mData; }
  std::uint8_t const* data() const { return mData; }
  /// @units Bytes.
  std::uint64_t size() const { return mSize; }
  bool empty() const { return mSize == 0; }
  /// The pool that this buffer belongs to, or null.
  std::shared_ptr<Pool> const& pool() const { return mPool; }

  /// Leaves the pool and becomes empty. The bytes are not given back to the pool.
  void clear() noexcept;

private:
  explicit AlignedHostBuffer(std::shared_ptr<Pool> pool) noexcept;
  void take(AlignedHostBuffer& other) noexcept;

  std::shared_ptr<Pool> mPool;
  std::uint64_t mSize = 0;
  std::uint8_t* mData = nullptr;
};

/// The block that buffers come from. Only its buffers own it.
/// @threads create(), clear() and moves of different buffers may run at the same time, except for two draws
/// at once: the test for room comes before the lock.
class VLN_API AlignedHostBuffer::Pool {
public:
  /// @error std::runtime_error when there is no memory for the block.
  Pool(std::uint64_t size, void* data);
  Pool(Pool const&) = delete;
  Pool& operator=(Pool const&) = delete;
  ~Pool();

  /// Gives the buffer, which belongs to this pool, the next `size` bytes.
  /// @error std::runtime_error when less is left; nothing has changed then.
  void alloc(AlignedHostBuffer* buffer, std::uint64_t size);

  /// @units Bytes: of the block, and of what has been handed out so far.
  std::uint64_t size() const { return mSize; }
  std::uint64_t used() const { return static_cast<std::uint64_t>(mFree - mData); }
  /// Buffers that hold a range of this pool.
  std::uint64_t bufferCount();
  bool isManaged() const { return mManaged; }

private:
  friend class AlignedHostBuffer;

  void replace(AlignedHostBuffer* from, AlignedHostBuffer* to);

  std::mutex mMutex;
  std::unordered_set<AlignedHostBuffer*> mRegister;
  std::uint8_t* mData;
  std::uint8_t* mFree;
  std::uint64_t mSize;
  bool mManaged;
};

} // namespace nanovtt
