#pragma once

#include "GeometryVolume/pools/ArrayPool.h"

#include <gtest/gtest.h>
#include <vector>

namespace test {

namespace ArrayPool = VLN::TileTree3D::ArrayPool;

/// The pool on and empty; off again at the end.
class ArrayPoolTest : public ::testing::Test {
protected:
  using Bytes = Ostil::Ptr<Ostil::Array<unsigned char>>;

  ArrayPoolTest() {
    ArrayPool::enable();
    ArrayPool::resetAllocationCount();
  }
  ~ArrayPoolTest() override {
    ArrayPool::disableLog();
    ArrayPool::enable();
    ArrayPool::freeAllMemory();
    ArrayPool::enableRequiredFreeSize();
    ArrayPool::setRequiredFreeSize(0);
    ArrayPool::disableRequiredFreeSize();
    ArrayPool::disable();
  }
  /// Leaves idle arrays of these capacities in the pool, in this order; tells their addresses.
  static std::vector<void*> idle(std::vector<std::uint64_t> const& capacities) {
    std::vector<Bytes> held;
    std::vector<void*> addresses;
    for (auto capacity : capacities) {
      held.push_back(ArrayPool::allocate<unsigned char>(0, capacity));
      addresses.push_back(held.back().get());
    }
    return addresses;
  }
};

} // namespace test
