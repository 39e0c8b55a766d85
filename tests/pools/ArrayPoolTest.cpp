#include "ArrayPoolFixture.h"
#include "ControlGroup.h"
#include "GeometryVolume/core/ElementTypes.h"
#include "GeometryVolume/core/Parallel.h"

#include <algorithm>
#include <limits>
#include <stdexcept>
#include <type_traits>

namespace {

using test::ArrayPoolTest;
namespace ArrayPool = test::ArrayPool;

TEST(ArrayPoolOff, RequirementHandsOutNullAndAnswersNothing) {
  ArrayPool::resetAllocationCount(); // tests before this one leave it where it was
  ASSERT_FALSE(ArrayPool::enabled());
  EXPECT_FALSE(ArrayPool::allocate<float>(1.0f, 10));
  EXPECT_EQ(ArrayPool::allocationCount(), 0u);
  ArrayPool::enable();
  EXPECT_EQ(ArrayPool::allocationCount(), 0u) << "the clock did not advance";
  auto const held = ArrayPool::allocate<float>(1.0f, 10);
  EXPECT_EQ(ArrayPool::usedStoreSize(), 1u);
  ArrayPool::disable();
  EXPECT_EQ(ArrayPool::usedStoreSize(), 0u);
  EXPECT_EQ(ArrayPool::freeStoreSize(), 0u);
  EXPECT_EQ(ArrayPool::allocatedMemory(), 0u);
  EXPECT_EQ(ArrayPool::availableMemory(), 0u);
  EXPECT_EQ(ArrayPool::requiredFreeSize(), 0u);
  EXPECT_EQ(ArrayPool::allocationCount(), 0u);
  EXPECT_EQ(held->size(), 10u) << "its holder keeps it";
  EXPECT_EQ(held.useCount(), 1);
  ArrayPool::enableRequiredFreeSize();
  ArrayPool::disableRequiredFreeSize();
  ArrayPool::freeMemory(1);
  ArrayPool::freeAllMemory();
  ArrayPool::freeMemoryNotUsedSinceCount(1);
  ArrayPool::dump();
  ArrayPool::enable();
  EXPECT_EQ(ArrayPool::allocationCount(), 1u) << "the clock goes on";
  ArrayPool::resetAllocationCount();
  ArrayPool::disable();
}

template <class T> void handsOut(T value) {
  auto const array = ArrayPool::allocate<T>(value, 5);
  ASSERT_TRUE(array);
  EXPECT_EQ(array->size(), 5u);
  EXPECT_EQ(array->capacity(), 8u);
  EXPECT_EQ(std::count(array->begin(), array->end(), value), 5);
  EXPECT_EQ(array.useCount(), 2);
}

TEST_F(ArrayPoolTest, RequirementEveryElementTypeHasAStoreOfItsOwn) {
  std::uint64_t types = 0, bytes = 0;
#define VLN_CHECK(type, name)                                                                                \
  handsOut(std::type_identity_t<type>{});                                                                    \
  ++types, bytes += 8 * sizeof(type);                                                                        \
  EXPECT_EQ(ArrayPool::freeStoreSize(), types) << #name;                                                     \
  EXPECT_EQ(ArrayPool::allocatedMemory(), bytes) << #name;
  VLN_FOR_EACH_ELEMENT_TYPE(VLN_CHECK)
#undef VLN_CHECK
  handsOut<float>(1.5f);
  EXPECT_EQ(ArrayPool::freeStoreSize(), types) << "the idle one was taken";
}

TEST_F(ArrayPoolTest, RequirementAnArrayReturnsWhenItsHolderLetsGo) {
  auto first = ArrayPool::allocate<float>(1.0f, 100);
  auto const second = ArrayPool::allocate<float>(2.0f, 100);
  EXPECT_NE(first.get(), second.get());
  EXPECT_EQ(ArrayPool::usedStoreSize(), 2u);
  void* const address = first.get();
  first.reset();
  EXPECT_EQ(ArrayPool::freeStoreSize(), 1u);
  auto const third = ArrayPool::allocate<float>(3.0f, 100);
  EXPECT_EQ(third.get(), address);
  EXPECT_EQ(std::count(third->begin(), third->end(), 3.0f), 100);
  EXPECT_EQ(ArrayPool::allocationCount(), 3u);
}

TEST_F(ArrayPoolTest, RequirementBestFit) {
  auto const arrays = idle({8, 16, 32});
  EXPECT_EQ(ArrayPool::allocate<unsigned char>(0, 10).get(), arrays[1]) << "the smallest sufficient";
  EXPECT_EQ(ArrayPool::allocate<unsigned char>(0, 16).get(), arrays[1]) << "exact";
  auto const grown = ArrayPool::allocate<unsigned char>(7, 64);
  EXPECT_EQ(grown.get(), arrays[2]) << "failing that, the largest";
  EXPECT_EQ(grown->capacity(), 64u);
  EXPECT_EQ(std::count(grown->begin(), grown->end(), 7), 64);
}

TEST_F(ArrayPoolTest, BoundaryBestFitDependsOnTheOrderWhenAnExactOneComesLater) {
  // An exact capacity wins over a smaller one, yet does not displace a larger one met before it.
  auto const rising = idle({16, 32});
  EXPECT_EQ(ArrayPool::allocate<unsigned char>(0, 16).get(), rising[0]) << "never displaced";
  ArrayPool::freeAllMemory();
  auto const falling = idle({32, 16});
  EXPECT_EQ(ArrayPool::allocate<unsigned char>(0, 16).get(), falling[0]);
  EXPECT_EQ(ArrayPool::allocate<unsigned char>(0, 15).get(), falling[1]) << "smaller, and still sufficient";
}

TEST_F(ArrayPoolTest, BoundaryOfEqualCapacitiesTheEarlierStays) {
  auto const arrays = idle({16, 16});
  EXPECT_EQ(ArrayPool::allocate<unsigned char>(0, 10).get(), arrays[0]);
  EXPECT_EQ(ArrayPool::allocate<unsigned char>(0, 20).get(), arrays[0]);
}

TEST_F(ArrayPoolTest, RequirementTheFillIsTheSameAtEveryThreadCount) {
  std::uint64_t const n = 1000003;
  for (int threads : {1, 2, 8}) {
    VLN::withThreads(threads, [&] {
      auto const array = ArrayPool::allocate<std::int64_t>(threads, n);
      ASSERT_EQ(array->size(), n);
      EXPECT_EQ(std::count(array->begin(), array->end(), std::int64_t(threads)), std::ptrdiff_t(n));
    });
  }
  EXPECT_EQ(ArrayPool::freeStoreSize(), 1u);
}

TEST_F(ArrayPoolTest, BoundaryNoElements) {
  auto const array = ArrayPool::allocate<int>(4, 0);
  ASSERT_TRUE(array);
  EXPECT_TRUE(array->empty());
  EXPECT_EQ(array->capacity(), 0u);
  EXPECT_EQ(ArrayPool::allocate<int>(4, 1)->capacity(), 1u);
}

TEST_F(ArrayPoolTest, NegativeAnImpossibleCountThrowsAndReleasesTheLock) {
  EXPECT_THROW(ArrayPool::allocate<std::int64_t>(0, std::numeric_limits<std::uint64_t>::max()),
               std::length_error);
  EXPECT_EQ(ArrayPool::usedStoreSize() + ArrayPool::freeStoreSize(), 0u);
  auto const array = ArrayPool::allocate<std::int64_t>(1, 3);
  EXPECT_THROW(ArrayPool::allocate<std::int64_t>(0, std::uint64_t(1) << 61), std::length_error);
  EXPECT_EQ(array->size(), 3u);
}

TEST_F(ArrayPoolTest, RequirementCapacityAboveTheExactFloatsCopes) {
  // log(2097153) * (1 / log(2)) rounds to 21 in float: the capacity is one short.
  ASSERT_EQ(ArrayPool::capacityFor(2097153), 2097152u);
  for (int round = 0; round < 2; ++round) {
    auto const array = ArrayPool::allocate<unsigned char>(3, 2097153);
    EXPECT_EQ(array->size(), 2097153u);
    EXPECT_GE(array->capacity(), 2097153u);
    EXPECT_EQ(std::count(array->begin(), array->end(), 3), 2097153);
  }
  EXPECT_EQ(ArrayPool::freeStoreSize(), 1u);
}

TEST_F(ArrayPoolTest, RequirementAmounts) {
  test::ControlGroup group;
  group.setFree(5000000);
  EXPECT_EQ(ArrayPool::availablePhysicalMemory(), 5000000u);
  EXPECT_EQ(ArrayPool::totalPhysicalMemory(), test::ControlGroup::kLimit);
  auto const used = ArrayPool::allocate<std::int64_t>(0, 8);
  idle({1024});
  EXPECT_EQ(ArrayPool::allocatedMemory(), 64u + 1024u);
  EXPECT_EQ(ArrayPool::availableMemory(), 5000000u + 1024u);
  ArrayPool::enableRequiredFreeSize();
  ArrayPool::setRequiredFreeSize(1000);
  EXPECT_EQ(ArrayPool::requiredFreeSize(), 1000u);
  EXPECT_EQ(ArrayPool::availableMemory(), 5000000u + 24u);
  ArrayPool::setRequiredFreeSize(4999999);
  EXPECT_EQ(ArrayPool::availableMemory(), 1u + 1024u);
  group.makeUnreadable();
  EXPECT_EQ(ArrayPool::availablePhysicalMemory(), 0u);
  EXPECT_EQ(ArrayPool::totalPhysicalMemory(), 0u);
  EXPECT_EQ(ArrayPool::availableMemory(), 0u) << "not below 0";
  ArrayPool::disableRequiredFreeSize();
  EXPECT_EQ(ArrayPool::availableMemory(), 1024u) << "idle arrays only";
}

TEST_F(ArrayPoolTest, RequirementTheRequiredSizeIsLostWhileItIsOff) {
  ArrayPool::setRequiredFreeSize(500);
  ArrayPool::addRequiredFreeSize(500);
  ArrayPool::subtractRequiredFreeSize(1);
  ArrayPool::enableRequiredFreeSize();
  EXPECT_EQ(ArrayPool::requiredFreeSize(), 0u);
  ArrayPool::addRequiredFreeSize(300);
  ArrayPool::addRequiredFreeSize(400);
  EXPECT_EQ(ArrayPool::requiredFreeSize(), 700u);
  ArrayPool::subtractRequiredFreeSize(600);
  EXPECT_EQ(ArrayPool::requiredFreeSize(), 100u);
  ArrayPool::subtractRequiredFreeSize(101);
  EXPECT_EQ(ArrayPool::requiredFreeSize(), 0u);
  ArrayPool::setRequiredFreeSize(50);
  ArrayPool::addRequiredFreeSize(std::numeric_limits<std::uint64_t>::max());
  EXPECT_EQ(ArrayPool::requiredFreeSize(), std::numeric_limits<std::uint64_t>::max());
}

TEST_F(ArrayPoolTest, RequirementAgeing) {
  auto const arrays = idle({8, 16, 32}); // counts 1, 2, 3
  ArrayPool::freeMemoryNotUsedSinceCount(0);
  EXPECT_EQ(ArrayPool::freeStoreSize(), 3u);
  auto const used = ArrayPool::allocate<unsigned char>(0, 8); // the first again, count 4
  EXPECT_EQ(used.get(), arrays[0]);
  ArrayPool::freeMemoryNotUsedSinceCount(3);
  EXPECT_EQ(ArrayPool::freeStoreSize(), 1u) << "the array of count 3";
  EXPECT_EQ(ArrayPool::usedStoreSize(), 1u);
  EXPECT_EQ(ArrayPool::allocatedMemory(), 8u + 32u);
  ArrayPool::freeMemoryNotUsedSinceCount(5);
  EXPECT_EQ(ArrayPool::usedStoreSize() + ArrayPool::freeStoreSize(), 0u);
  EXPECT_EQ(used.useCount(), 1) << "in use, it loses the pool's reference only";
}

TEST_F(ArrayPoolTest, RequirementAfterAResetAgeingDropsWhatWasNotHandedOutSince) {
  idle({8, 16, 32});
  ArrayPool::resetAllocationCount();
  EXPECT_EQ(ArrayPool::allocationCount(), 0u);
  EXPECT_EQ(ArrayPool::freeStoreSize(), 3u);
  auto const used = ArrayPool::allocate<unsigned char>(0, 16);
  ArrayPool::freeMemoryNotUsedSinceCount(0);
  EXPECT_EQ(ArrayPool::freeStoreSize(), 0u);
  EXPECT_EQ(ArrayPool::usedStoreSize(), 1u);
}

TEST_F(ArrayPoolTest, RequirementFreeingAllForgetsArraysInUseToo) {
  idle({8});
  auto const used = ArrayPool::allocate<float>(1.0f, 8);
  ArrayPool::freeAllMemory();
  EXPECT_EQ(ArrayPool::usedStoreSize() + ArrayPool::freeStoreSize(), 0u);
  EXPECT_EQ(ArrayPool::allocationCount(), 2u) << "the clock stays";
  EXPECT_EQ(used.useCount(), 1);
}

} // namespace
