#include "GeometryVolume/nanovtt/AlignedHostBuffer.h"

#include <cstdlib>
#include <limits>
#include <sstream>
#include <stdexcept>
#include <utility>

#if defined(__linux__)
#include <sys/mman.h>
#endif

namespace nanovtt {

using Pool = AlignedHostBuffer::Pool;

namespace {

/// Asks for large pages behind a large block: the first touch of small ones takes longer than filling them.
void adviseLargePages([[maybe_unused]] std::uint8_t* block, [[maybe_unused]] std::uint64_t size) {
#if defined(__linux__) && defined(MADV_HUGEPAGE)
  constexpr std::uint64_t kSmall = 4096, kLarge = std::uint64_t(2) << 20;
  if (size < 2 * kLarge) return;
  std::uint64_t const past = reinterpret_cast<std::uintptr_t>(block) % kSmall,
                      skip = past ? kSmall - past : 0;
  // Advice alone: where it is not taken, all is as before.
  (void)madvise(block + skip, size - skip, MADV_HUGEPAGE);
#endif
}

} // namespace

Pool::Pool(std::uint64_t size, void* data)
    : mData(static_cast<std::uint8_t*>(data))
    , mSize(size)
    , mManaged(!data) {
  if (mManaged) {
    // One unit more than asked for when the size is a multiple already: no block is ever of size 0.
    std::uint64_t const wholeUnits = size - size % kAlignment;
    bool const fits = wholeUnits <= std::numeric_limits<std::size_t>::max() - kAlignment;
    if (fits) mData = static_cast<std::uint8_t*>(std::aligned_alloc(kAlignment, wholeUnits + kAlignment));
    if (!mData) throw std::runtime_error("Pool::Pool malloc failed");
    adviseLargePages(mData, wholeUnits);
  }
  mFree = mData;
}

Pool::~Pool() {
  if (mManaged) std::free(mData);
}

void Pool::alloc(AlignedHostBuffer* buffer, std::uint64_t size) {
  // In this form the test cannot wrap around, however large the request is.
  if (size <= mSize - used()) {
    std::lock_guard const lock(mMutex);
    mRegister.insert(buffer);
    buffer->mSize = size;
    buffer->mData = mFree;
    mFree += size;
    return;
  }
  std::ostringstream text;
  text << "AlignedHostBuffer::Pool: insufficient memory\n"
       << "\tA buffer requested " << size << " bytes from a pool with " << mSize << " bytes of which\n\t"
       << used() << " bytes are used by " << bufferCount() << " other buffer(s). "
       << "Pool is " << (mManaged ? "internally" : "externally") << " managed.\n";
  throw std::runtime_error(text.str());
}

std::uint64_t Pool::bufferCount() {
  std::lock_guard const lock(mMutex);
  return mRegister.size();
}

// A buffer that only belongs to the pool, and holds no range of it, is not in the register and stays out of
// it.
void Pool::replace(AlignedHostBuffer* from, AlignedHostBuffer* to) {
  std::lock_guard const lock(mMutex);
  // The node is used again: a move cannot run out of memory.
  auto node = mRegister.extract(from);
  if (node.empty()) return;
  node.value() = to;
  mRegister.insert(std::move(node));
}

AlignedHostBuffer::AlignedHostBuffer(std::shared_ptr<Pool> pool) noexcept
    : mPool(std::move(pool)) {}

AlignedHostBuffer::AlignedHostBuffer(AlignedHostBuffer&& other) noexcept { take(other); }

AlignedHostBuffer& AlignedHostBuffer::operator=(AlignedHostBuffer&& other) noexcept {
  if (this != &other) {
    clear();
    take(other);
  }
  return *this;
}

void AlignedHostBuffer::take(AlignedHostBuffer& other) noexcept {
  mPool = std::move(other.mPool);
  mSize = std::exchange(other.mSize, 0);
  mData = std::exchange(other.mData, nullptr);
  if (mPool) mPool->replace(&other, this);
}

AlignedHostBuffer AlignedHostBuffer::create(std::uint64_t size, AlignedHostBuffer const* pool) {
  AlignedHostBuffer buffer(pool && pool->mPool ? pool->mPool : std::make_shared<Pool>(size, nullptr));
  buffer.mPool->alloc(&buffer, size);
  return buffer;
}

AlignedHostBuffer AlignedHostBuffer::createAligned(std::uint64_t size, AlignedHostBuffer const* pool) {
  AlignedHostBuffer pad;
  if (pool && pool->mPool) {
    Pool const& source = *pool->mPool;
    std::uint64_t const askew = reinterpret_cast<std::uintptr_t>(source.mFree) % kAlignment;
    std::uint64_t const left = source.size() - source.used();
    if (askew && kAlignment - askew <= left && size <= left - (kAlignment - askew))
      pad = create(kAlignment - askew, pool);
  }
  return create(size, pool);
}

AlignedHostBuffer AlignedHostBuffer::createPool(std::uint64_t size, void* block) {
  return AlignedHostBuffer(std::make_shared<Pool>(size, block));
}

void AlignedHostBuffer::clear() noexcept {
  if (mPool) {
    std::lock_guard const lock(mPool->mMutex);
    mPool->mRegister.erase(this);
  }
  // Not before the mutex, which goes with the pool, is unlocked.
  mPool.reset();
  mSize = 0;
  mData = nullptr;
}

} // namespace nanovtt
