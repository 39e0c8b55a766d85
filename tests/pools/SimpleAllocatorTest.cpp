#include "FakeBulk.h"

#include <limits>

namespace {

using test::FakeBulk;
using VLN::TileTree3D::SimpleAllocator;
using Bytes = std::vector<std::uint64_t>;

class SimpleAllocatorTest : public ::testing::Test {
protected:
  SimpleAllocatorTest() { FakeBulk::reset(); }
  /// Leaves free blocks of these very sizes.
  std::vector<void*> freeBlocks(Bytes const& sizes) {
    pool.setExtra(0);
    std::vector<void*> blocks;
    for (auto size : sizes) blocks.push_back(pool.allocate(size));
    for (void* block : blocks) pool.deallocate(block);
    pool.setExtra(0.1f);
    FakeBulk::made.clear();
    return blocks;
  }
  SimpleAllocator pool{FakeBulk::functions()};
};

TEST_F(SimpleAllocatorTest, RequirementNewBlocksHoldATenthMore) {
  pool.allocate(1000);
  EXPECT_EQ(FakeBulk::made, Bytes{1100});
  EXPECT_EQ(pool.usedStoreSize(), 1u);
  EXPECT_EQ(pool.freeStoreSize(), 0u);
}

TEST_F(SimpleAllocatorTest, RequirementALargerBlockServesTheSameRequestAgain) {
  void* const first = pool.allocate(1000);
  pool.deallocate(first);
  EXPECT_EQ(pool.freeStoreAvailableMemory(), 1100u);
  EXPECT_EQ(pool.allocate(1000), first);
  pool.deallocate(first);
  EXPECT_EQ(pool.allocate(1100), first) << "the same size";
  EXPECT_EQ(FakeBulk::made, Bytes{1100});
}

TEST_F(SimpleAllocatorTest, RequirementTheLargerOfTwoNeighboursIsTaken) {
  auto const blocks = freeBlocks({100, 300});
  EXPECT_EQ(pool.allocate(200), blocks[1]);
  EXPECT_EQ(pool.freeStoreAvailableMemory(), 100u);
}

TEST_F(SimpleAllocatorTest, RequirementOfLargerBlocksTheSmallestIsTaken) {
  auto const blocks = freeBlocks({500, 300, 400});
  EXPECT_EQ(pool.allocate(200), blocks[1]);
  EXPECT_EQ(pool.allocate(200), blocks[2]);
  EXPECT_EQ(pool.allocate(200), blocks[0]);
}

TEST_F(SimpleAllocatorTest, BoundaryOfEqualBlocksTheFirstIsTaken) {
  auto const blocks = freeBlocks({300, 300, 300});
  EXPECT_EQ(pool.allocate(300), blocks[0]);
  EXPECT_EQ(pool.allocate(200), blocks[1]);
}

TEST_F(SimpleAllocatorTest, RequirementALargestSmallerBlockGrowsInPlace) {
  auto const blocks = freeBlocks({100, 200});
  FakeBulk::growth = FakeBulk::Growth::kAlways;
  EXPECT_EQ(pool.allocate(250), blocks[1]);
  EXPECT_TRUE(FakeBulk::made.empty());
  EXPECT_EQ(pool.freeStoreSize(), 1u);
  pool.deallocate(blocks[1]);
  EXPECT_EQ(pool.freeStoreAvailableMemory(), 366u) << "the size that the block really has";
}

TEST_F(SimpleAllocatorTest, RequirementABlockThatCannotGrowIsReplaced) {
  auto const blocks = freeBlocks({100, 200});
  void* const block = pool.allocate(250);
  EXPECT_NE(block, blocks[1]);
  EXPECT_EQ(FakeBulk::freed, std::vector<void*>{blocks[1]});
  EXPECT_EQ(FakeBulk::made, Bytes{275});
  EXPECT_EQ(pool.freeStoreSize(), 1u);
  EXPECT_EQ(pool.usedStoreSize(), 1u);
}

TEST_F(SimpleAllocatorTest, RequirementNoSlackMakesBlocksOfTheRequestedSize) {
  pool.setExtra(0);
  pool.allocate(1000);
  pool.allocate(1);
  EXPECT_EQ(FakeBulk::made, (Bytes{1000, 1}));
}

TEST_F(SimpleAllocatorTest, NegativeSlackBelowZeroIsNone) {
  pool.setExtra(-0.5f);
  pool.allocate(1000);
  pool.setExtra(std::numeric_limits<float>::quiet_NaN());
  pool.allocate(1000);
  EXPECT_EQ(FakeBulk::made, (Bytes{1000, 1000}));
}

TEST_F(SimpleAllocatorTest, BoundaryTheSlackIsCountedInFloat) {
  // 16777217 is no float: it rounds to 16777216, whose tenth in float is 1677721.625.
  pool.allocate(16777217);
  EXPECT_EQ(FakeBulk::made, Bytes{16777217 + 1677721});
}

TEST_F(SimpleAllocatorTest, BoundaryAHugeRequestDoesNotWrapAround) {
  std::uint64_t const most = std::numeric_limits<std::uint64_t>::max();
  FakeBulk::exhausted = true;
  EXPECT_EQ(pool.allocate(most), nullptr);
  EXPECT_EQ(pool.allocate(most - 5), nullptr);
  EXPECT_EQ(FakeBulk::made, (Bytes{most, most}));
}

TEST_F(SimpleAllocatorTest, NegativeNoMemoryIsRecordedAndAnswersNull) {
  FakeBulk::exhausted = true;
  EXPECT_EQ(pool.allocate(1000), nullptr);
  EXPECT_EQ(pool.allocate(1000), nullptr);
  EXPECT_EQ(pool.usedStoreSize(), 2u);
  pool.deallocate(nullptr);
  EXPECT_EQ(pool.freeStoreSize(), 1u);
  FakeBulk::exhausted = false;
  EXPECT_NE(pool.allocate(5000), nullptr) << "no memory cannot grow in place";
}

TEST_F(SimpleAllocatorTest, BoundaryAnEmptyRequestTakesAtLeastOneByte) {
  void* const block = pool.allocate(0);
  ASSERT_NE(block, nullptr);
  EXPECT_EQ(FakeBulk::made, Bytes{1});
  pool.deallocate(block);
  EXPECT_EQ(pool.freeStoreSize(), 1u);
  EXPECT_EQ(pool.freeStoreAvailableMemory(), 0u) << "the recorded size stays 0";
  FakeBulk::growth = FakeBulk::Growth::kAlways;
  EXPECT_EQ(pool.allocate(0), block);
  pool.deallocate(block);
  EXPECT_EQ(pool.allocate(50), block) << "grown from nothing";
  pool.deallocate(block);
  EXPECT_EQ(pool.freeStoreAvailableMemory(), 66u);
}

TEST_F(SimpleAllocatorTest, RequirementAgeingFreesWhatIsOlderThanTheCount) {
  pool.setExtra(0);
  void* const a = pool.allocate(100); // count 1
  void* const b = pool.allocate(200); // count 2
  void* const c = pool.allocate(300); // count 3, stays in use
  pool.deallocate(a);
  pool.deallocate(b);
  EXPECT_EQ(pool.allocationCount(), 3u);
  pool.freeMemoryNotUsedSinceCount(2);
  EXPECT_EQ(FakeBulk::freed, std::vector<void*>{a});
  EXPECT_EQ(pool.freeStoreAvailableMemory(), 200u);
  pool.freeMemoryNotUsedSinceCount(100);
  EXPECT_EQ(FakeBulk::freed, (std::vector<void*>{a, b}));
  EXPECT_EQ(pool.usedStoreSize(), 1u) << "blocks in use are never touched";
  pool.deallocate(c);
}

TEST_F(SimpleAllocatorTest, RequirementAgeingShrinksToTheLargestRequestAndSlackOfTheSize) {
  auto const blocks = freeBlocks({1100});
  pool.resetAllocationCount();
  pool.deallocate(pool.allocate(500)); // the larger block, with 500 as its largest request since the reset
  pool.freeMemoryNotUsedSinceCount(1);
  EXPECT_EQ(FakeBulk::shrunk, (std::vector<std::pair<void*, std::uint64_t>>{{blocks[0], 610}}));
  EXPECT_EQ(pool.freeStoreAvailableMemory(), 610u);
  EXPECT_EQ(pool.allocate(610), blocks[0]);
}

TEST_F(SimpleAllocatorTest, RequirementAfterAResetAgeingKeepsTheSlackOnly) {
  auto const blocks = freeBlocks({1000, 5});
  pool.resetAllocationCount();
  EXPECT_EQ(pool.allocationCount(), 0u);
  pool.freeMemoryNotUsedSinceCount(0);
  EXPECT_TRUE(FakeBulk::freed.empty());
  using Shrunk = std::vector<std::pair<void*, std::uint64_t>>;
  EXPECT_EQ(FakeBulk::shrunk, (Shrunk{{blocks[1], 1}, {blocks[0], 100}})) << "rising; never below one byte";
  EXPECT_EQ(pool.freeStoreAvailableMemory(), 100u) << "the recorded size is 0";
}

TEST_F(SimpleAllocatorTest, BoundaryAgeingLeavesABlockThatFits) {
  pool.deallocate(pool.allocate(1000)); // 1100 held, target 1000 + 110
  pool.freeMemoryNotUsedSinceCount(1);
  EXPECT_TRUE(FakeBulk::shrunk.empty());
  EXPECT_EQ(pool.freeStoreAvailableMemory(), 1100u);
}

TEST_F(SimpleAllocatorTest, RequirementAResetLeavesBlocksInUseAlone) {
  pool.setExtra(0);
  void* const a = pool.allocate(100);
  pool.allocate(50);
  void* const b = pool.allocate(200); // count 3
  pool.resetAllocationCount();
  pool.deallocate(a);
  pool.deallocate(b);
  pool.freeMemoryNotUsedSinceCount(2);
  EXPECT_EQ(FakeBulk::freed, std::vector<void*>{a}) << "each kept the count of its hand-out";
}

TEST_F(SimpleAllocatorTest, RequirementFreeingAllLeavesBlocksInUse) {
  auto const blocks = freeBlocks({100, 200});
  void* const used = pool.allocate(150);
  pool.freeAllMemory();
  EXPECT_EQ(FakeBulk::freed, std::vector<void*>{blocks[0]});
  EXPECT_EQ(pool.freeStoreSize(), 0u);
  EXPECT_EQ(pool.usedStoreSize(), 1u);
  pool.deallocate(used);
  EXPECT_EQ(pool.freeStoreSize(), 1u);
}

TEST_F(SimpleAllocatorTest, NegativeAForeignBlockGoesToTheBulkAllocator) {
  void* const foreign = FakeBulk::functions().mallocx(64, 6);
  pool.deallocate(foreign);
  EXPECT_EQ(FakeBulk::freed, std::vector<void*>{foreign});
  EXPECT_EQ(pool.freeStoreSize(), 0u);
}

TEST_F(SimpleAllocatorTest, NegativeABlockFreedElsewhereMayComeAgain) {
  void* const block = pool.allocate(1000);
  FakeBulk::functions().free(block);
  FakeBulk::next -= 64;
  EXPECT_EQ(pool.allocate(50), block);
  EXPECT_EQ(pool.usedStoreSize(), 1u);
  pool.deallocate(block);
  EXPECT_EQ(pool.freeStoreAvailableMemory(), 55u);
}

} // namespace
