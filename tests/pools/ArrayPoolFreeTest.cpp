// Keeping memory free: every way that freeMemory() can end, with a pretended control group that says how much
// is free at each step.
#include "ArrayPoolFixture.h"
#include "PoolScript.h"

#include <set>

namespace {

using test::kMB;
namespace ArrayPool = test::ArrayPool;

class ArrayPoolFree : public test::ArrayPoolTest {
protected:
  ArrayPoolFree() {
    ArrayPool::enableLog();
    script.group.setFree(10 * kMB);
  }
  /// Number of tries of the last freeMemory().
  int tries() { return script.out.count("ArrayPool:Attempting freeing of memory, try #"); }
  std::string removed() { return script.out.after("ArrayPool: removing "); }
  bool ok() { return script.out.count("ArrayPool:OK: Enough physical memory now available (") == 1; }
  bool warned() { return script.out.count("ArrayPool:Warning: NOT enough physical memory available (") == 1; }
  static constexpr char const* kRemoving = "ArrayPool: removing ";
  test::PoolScript script;
};

TEST_F(ArrayPoolFree, RequirementDropsTheSmallestUntilTheirSumIsEnough) {
  auto const arrays = idle({4 * kMB, kMB, 2 * kMB});
  script.out.take();
  script.free(kRemoving, 13);
  ArrayPool::freeMemory(3 * kMB);
  EXPECT_TRUE(script.done());
  EXPECT_EQ(tries(), 1);
  EXPECT_EQ(removed(), "2 arrays of total size 3MB");
  EXPECT_TRUE(ok());
  EXPECT_EQ(ArrayPool::freeStoreSize(), 1u);
  EXPECT_EQ(ArrayPool::allocate<unsigned char>(0, kMB).get(), arrays[0]) << "the largest is left";
}

TEST_F(ArrayPoolFree, RequirementATryTakesTheWholeAmountAgain) {
  idle({kMB, kMB, kMB, kMB, kMB, kMB, kMB});
  script.out.take();
  // The first two tries free less than their arrays held: others took the memory.
  script.free(kRemoving, 11).free(kRemoving, 12).free(kRemoving, 13);
  ArrayPool::freeMemory(3 * kMB);
  EXPECT_EQ(tries(), 3);
  EXPECT_EQ(script.out.count("ArrayPool: removing 3 arrays of total size 3MB"), 2);
  EXPECT_EQ(script.out.count("ArrayPool: removing 1 arrays of total size 1MB"), 1);
  EXPECT_EQ(script.out.count("ArrayPool: Enough physical memory is still not available: "), 2);
  EXPECT_TRUE(ok());
  EXPECT_EQ(ArrayPool::freeStoreSize(), 0u);
}

TEST_F(ArrayPoolFree, NegativeNotEnough) {
  idle({kMB, 2 * kMB});
  auto const used = ArrayPool::allocate<unsigned char>(1, 8 * kMB);
  idle({kMB});
  script.out.take();
  ArrayPool::freeMemory(50 * kMB);
  EXPECT_EQ(tries(), 1) << "one try takes everything";
  EXPECT_TRUE(warned());
  EXPECT_EQ(ArrayPool::freeStoreSize(), 0u);
  EXPECT_EQ(ArrayPool::usedStoreSize(), 1u) << "arrays in use survive";
  EXPECT_EQ((*used)[8 * kMB - 1], 1);
}

TEST_F(ArrayPoolFree, NegativeUnreadableFiguresDropEverythingTryByTry) {
  idle({kMB, kMB, kMB, kMB});
  script.out.take();
  script.unreadable(kRemoving);
  ArrayPool::freeMemory(2 * kMB);
  EXPECT_EQ(tries(), 2);
  EXPECT_EQ(script.out.count("ArrayPool: Enough physical memory is "), 0) << "nothing is known";
  EXPECT_TRUE(warned());
  EXPECT_EQ(ArrayPool::freeStoreSize(), 0u);
}

TEST_F(ArrayPoolFree, BoundaryUnreadableAtFirstCountsAsNothingFreeBefore) {
  idle({kMB, kMB});
  script.group.makeUnreadable();
  script.out.take();
  script.free(kRemoving, 1); // less than there was, and the megabyte that was asked for
  ArrayPool::freeMemory(kMB);
  EXPECT_EQ(tries(), 1);
  EXPECT_TRUE(ok());
  EXPECT_EQ(script.out.after("ArrayPool: Available physical before = "), "0MB");
  EXPECT_EQ(ArrayPool::freeStoreSize(), 1u);
}

TEST_F(ArrayPoolFree, BoundaryNothingIdle) {
  auto const used = ArrayPool::allocate<unsigned char>(0, kMB);
  script.out.take();
  ArrayPool::freeMemory(kMB);
  EXPECT_EQ(tries(), 0);
  EXPECT_TRUE(warned());
}

TEST_F(ArrayPoolFree, BoundaryNothingAskedFor) {
  idle({kMB});
  script.out.take();
  ArrayPool::freeMemory(0);
  EXPECT_EQ(script.out.all(), "");
  EXPECT_EQ(ArrayPool::freeStoreSize(), 1u);
}

TEST_F(ArrayPoolFree, BoundaryLessFreeThanBefore) {
  idle({kMB});
  script.out.take();
  script.free(kRemoving, 5);
  ArrayPool::freeMemory(kMB);
  EXPECT_TRUE(warned());
  EXPECT_EQ(script.out.after("ArrayPool: Satisfied free amount = "), "0MB");
}

TEST_F(ArrayPoolFree, RequirementAllStoresAreSearched) {
  ArrayPool::allocate<float>(0, kMB / 4);
  ArrayPool::allocate<int>(0, kMB / 2);
  ArrayPool::allocate<std::int64_t>(0, kMB / 2);
  script.out.take();
  script.free(kRemoving, 13);
  ArrayPool::freeMemory(3 * kMB);
  EXPECT_EQ(removed(), "2 arrays of total size 3MB") << "one of float, one of int";
  EXPECT_EQ(ArrayPool::allocatedMemory(), 4 * kMB);
}

// The required size

TEST_F(ArrayPoolFree, RequirementEnablingAndSettingFreeAtOnce) {
  idle({kMB, 2 * kMB, 4 * kMB});
  ArrayPool::enableRequiredFreeSize();
  EXPECT_EQ(ArrayPool::freeStoreSize(), 3u);
  ArrayPool::setRequiredFreeSize(10 * kMB);
  EXPECT_EQ(ArrayPool::freeStoreSize(), 3u) << "just enough is free";
  EXPECT_EQ(script.out.count("ArrayPool:Not necessary to free required memory: free physical memory = 10MB, "
                             "required = 10MB"),
            1);
  script.free(kRemoving, 11);
  ArrayPool::addRequiredFreeSize(kMB);
  EXPECT_EQ(ArrayPool::freeStoreSize(), 2u);
  EXPECT_TRUE(ok());
  script.out.take();
  ArrayPool::disableRequiredFreeSize();
  script.group.setFree(8 * kMB);
  script.free(kRemoving, 11);
  ArrayPool::enableRequiredFreeSize(); // still 11
  EXPECT_EQ(tries(), 1);
  EXPECT_EQ(removed(), "2 arrays of total size 6MB");
  EXPECT_EQ(script.out.after("ArrayPool: Requested total free amount = "), "3MB");
  EXPECT_EQ(ArrayPool::freeStoreSize(), 0u);
  script.out.take();
  script.group.makeUnreadable();
  ArrayPool::subtractRequiredFreeSize(kMB);
  EXPECT_EQ(script.out.count("ArrayPool: freeMemory.begin"), 0) << "unreadable: nothing can be decided";
  EXPECT_EQ(ArrayPool::requiredFreeSize(), 10 * kMB);
}

TEST_F(ArrayPoolFree, RequirementAllocationMakesRoomFirst) {
  idle({kMB, 4 * kMB});
  auto const used = ArrayPool::allocate<unsigned char>(0, 4 * kMB);
  ArrayPool::enableRequiredFreeSize();
  ArrayPool::setRequiredFreeSize(9 * kMB);
  script.out.take();
  // 3 MB of floats beside 9 MB: two are missing.
  script.free(kRemoving, 12);
  auto const array = ArrayPool::allocate<float>(1.0f, 3 * kMB / 4);
  EXPECT_TRUE(script.done());
  EXPECT_EQ(script.out.after("ArrayPool: Requested total free amount = "), "2MB");
  EXPECT_EQ(array->capacity(), kMB) << "4 MB: spare capacity, for there is enough";
  EXPECT_EQ(script.out.after("ArrayPool: Inserting into pool = "), "1");
  EXPECT_EQ(ArrayPool::usedStoreSize(), 2u);
}

TEST_F(ArrayPoolFree, NegativeWithoutRoomANewArrayIsExactAndStaysOutside) {
  ArrayPool::enableRequiredFreeSize();
  ArrayPool::setRequiredFreeSize(10 * kMB);
  script.out.take();
  auto array = ArrayPool::allocate<unsigned char>(5, 1000);
  EXPECT_EQ(array->capacity(), 1000u);
  EXPECT_EQ(array->size(), 1000u);
  EXPECT_EQ(script.out.after("ArrayPool: Inserting into pool = "), "0");
  EXPECT_EQ(array.useCount(), 1);
  EXPECT_EQ(ArrayPool::usedStoreSize() + ArrayPool::freeStoreSize(), 0u);
  EXPECT_EQ(ArrayPool::allocationCount(), 1u);
}

TEST_F(ArrayPoolFree, NegativeWithoutRoomAReusedArrayLeavesThePool) {
  auto const arrays = idle({16, 32, 64, 128});
  ArrayPool::enableRequiredFreeSize();
  ArrayPool::setRequiredFreeSize(10 * kMB);
  script.out.take();
  auto const fits = ArrayPool::allocate<unsigned char>(5, 20);
  EXPECT_EQ(fits.get(), arrays[1]) << "what fits needs no room";
  EXPECT_EQ(ArrayPool::usedStoreSize(), 1u);
  auto const grown = ArrayPool::allocate<unsigned char>(6, 1000);
  EXPECT_EQ(grown.get(), arrays[3]) << "the array chosen is not among those dropped for it";
  EXPECT_EQ(grown->size(), 1000u);
  EXPECT_EQ(grown->capacity(), 1000u);
  EXPECT_EQ(grown.useCount(), 1);
  EXPECT_EQ(ArrayPool::freeStoreSize(), 0u);
  EXPECT_EQ(ArrayPool::usedStoreSize(), 1u) << "the one that fits, not the one that grew";
  EXPECT_EQ(script.out.after("ArrayPool: Requested total free amount = "), "0.000854492MB")
      << "1024 less the 128 that it has";
}

TEST_F(ArrayPoolFree, RequirementAnExactBoundaryIsEnough) {
  ArrayPool::enableRequiredFreeSize();
  ArrayPool::setRequiredFreeSize(9 * kMB);
  script.out.take();
  auto const array = ArrayPool::allocate<unsigned char>(0, kMB);
  EXPECT_EQ(script.out.count("ArrayPool: freeMemory.begin"), 0);
  EXPECT_EQ(ArrayPool::usedStoreSize(), 1u);
}

TEST_F(ArrayPoolFree, NegativeUnreadableFiguresSkipTheCheck) {
  ArrayPool::enableRequiredFreeSize();
  ArrayPool::setRequiredFreeSize(9 * kMB);
  script.group.makeUnreadable();
  script.out.take();
  auto const array = ArrayPool::allocate<unsigned char>(0, 20 * kMB);
  EXPECT_EQ(script.out.count("ArrayPool: freeMemory.begin"), 0);
  EXPECT_EQ(ArrayPool::usedStoreSize(), 1u);
}

TEST_F(ArrayPoolFree, BoundaryAmountsDoNotWrapRound) {
  ArrayPool::enableRequiredFreeSize();
  ArrayPool::setRequiredFreeSize(UINT64_MAX - 5);
  script.out.take();
  auto const array = ArrayPool::allocate<std::int64_t>(0, 1000);
  EXPECT_EQ(array->capacity(), 1000u);
  EXPECT_EQ(script.out.count("ArrayPool: freeMemory.begin"), 1);
}

} // namespace
