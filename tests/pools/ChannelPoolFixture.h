#pragma once

#include "GeometryVolume/pools/ArrayPool.h"
#include "GeometryVolume/pools/ChannelPool.h"

#include <array>
#include <gtest/gtest.h>
#include <iostream>
#include <sstream>
#include <vector>

namespace test {

namespace ArrayPool = VLN::TileTree3D::ArrayPool;
namespace ChannelPool = VLN::TileTree3D::ChannelPool;
using VLN::TileTree3D::OddTraits;
using VLN::TileTree3D::PowerOfTwoTraits;

/// A tree component that has some tiles at depth 28, and at depth 27 an eighth as many.
class Tiles final : public VLN::TileTree3D::Component {
public:
  explicit Tiles(std::int64_t deepest, int elements = 64)
      : m_deepest(deepest)
      , m_elements(elements) {}
  std::uint64_t size() const override { return static_cast<std::uint64_t>(elementCount(-1)); }
  void update(VLN::Component const&) override {}
  std::int64_t elementCount(int depth) const override { return tileCount(depth) * m_elements; }
  int elementCount(VLN::TileTree3D::TreeIndex const&) const override { return m_elements; }
  std::int64_t tileCount(int depth) const override {
    if (depth == -1) return tileCount(27) + tileCount(28);
    return depth == 28 ? m_deepest : depth == 27 ? m_deepest / 8 : 0;
  }

private:
  std::int64_t m_deepest;
  int m_elements;
};

/// Swallows standard error: channels with static storage say there that blocks are not counted.
class QuietErrors {
public:
  QuietErrors()
      : m_before(std::cerr.rdbuf(m_text.rdbuf())) {}
  ~QuietErrors() { std::cerr.rdbuf(m_before); }
  QuietErrors(QuietErrors const&) = delete;
  QuietErrors& operator=(QuietErrors const&) = delete;

private:
  std::ostringstream m_text;
  std::streambuf* m_before;
};

/// Both pools on and empty; off again at the end.
class ChannelPoolTest : public ::testing::Test {
protected:
  template <int E, int H> using Floats = Ostil::Ptr<VLN::TileTree3D::Channel<PowerOfTwoTraits, float, E, H>>;
  using Density = Floats<4, 1>;

  ChannelPoolTest() {
    ArrayPool::enable();
    ChannelPool::enable();
    ArrayPool::resetAllocationCount();
    ChannelPool::resetAllocationCount();
  }
  ~ChannelPoolTest() override {
    ArrayPool::enable();
    ChannelPool::enable();
    ArrayPool::disableLog();
    ChannelPool::disableLog();
    ArrayPool::freeAllMemory();
    ChannelPool::freeAllMemory();
    ArrayPool::enableRequiredFreeSize();
    ChannelPool::enableRequiredFreeSize();
    ArrayPool::setRequiredFreeSize(0);
    ChannelPool::setRequiredFreeSize(0);
    ArrayPool::disableRequiredFreeSize();
    ChannelPool::disableRequiredFreeSize();
    ArrayPool::disable();
    ChannelPool::disable();
  }
  /// A channel of floats with a halo, brought into step with so many tiles.
  static Density density(std::int64_t tiles, float value = 0) {
    auto channel = ChannelPool::allocate<PowerOfTwoTraits, float, 4, 1>(value, false, true, 0, 28,
                                                                        std::uint64_t(tiles), nullptr);
    channel->update(Tiles(tiles));
    return channel;
  }
  /// Leaves idle channels of so many tiles in the pool; tells their addresses.
  static std::vector<void*> idle(std::vector<std::int64_t> const& tiles) {
    std::vector<Density> held;
    std::vector<void*> addresses;
    for (auto n : tiles) {
      held.push_back(density(n));
      addresses.push_back(held.back().get());
    }
    return addresses;
  }
  static std::uint64_t allocatedBy(VLN::Base const& channel) {
    std::uint64_t used = 0, allocated = 0;
    channel.memUse(used, allocated, false);
    return allocated;
  }
};

} // namespace test
