// GridHandle: owns the buffer of a converted volume.
#pragma once

#include <cstdint>
#include <utility>

namespace nanovtt {

/// Owns one buffer and moves it on.
template <class BufferT> class GridHandle {
public:
  /// An empty buffer.
  GridHandle() = default;
  explicit GridHandle(BufferT&& buffer) noexcept
      : mBuffer(std::move(buffer)) {}

  BufferT& buffer() { return mBuffer; }
  BufferT const& buffer() const { return mBuffer; }
  /// @edges Null for an empty buffer.
  std::uint8_t* data() { return mBuffer.data(); }
  std::uint8_t const* data() const { return mBuffer.data(); }
  /// @units Bytes.
  std::uint64_t size() const { return mBuffer.size(); }
  bool empty() const { return mBuffer.empty(); }
  explicit operator bool() const { return !empty(); }
  /// Lets go of the buffer.
  void reset() { mBuffer.clear(); }

private:
  BufferT mBuffer;
};

} // namespace nanovtt
