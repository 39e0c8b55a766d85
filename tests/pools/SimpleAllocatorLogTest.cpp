// What the allocator says when its log is on.
#include "CoutCapture.h"
#include "FakeBulk.h"

#include <sstream>

namespace {

using test::FakeBulk;
using VLN::TileTree3D::SimpleAllocator;
using Lines = std::vector<std::string>;

std::string text(void* p) {
  std::ostringstream os;
  os << p;
  return os.str();
}

class SimpleAllocatorLog : public ::testing::Test {
protected:
  SimpleAllocatorLog() { FakeBulk::reset(); }
  test::CoutCapture out;
  SimpleAllocator pool{FakeBulk::functions()};
};

TEST_F(SimpleAllocatorLog, RequirementNothingIsSaidWhileItIsOff) {
  pool.setExtra(0.2f);
  pool.deallocate(pool.allocate(10));
  pool.freeMemoryNotUsedSinceCount(0);
  pool.resetAllocationCount();
  pool.freeAllMemory();
  pool.disableLog();
  EXPECT_EQ(out.all(), "");
}

TEST_F(SimpleAllocatorLog, RequirementSwitches) {
  pool.enableLog();
  EXPECT_EQ(out.take(), Lines{"enableLog.end"});
  pool.enableLog();
  EXPECT_EQ(out.take(), (Lines{"enableLog.begin", "enableLog.end"}));
  pool.setExtra(0.5f);
  EXPECT_EQ(out.take(), (Lines{"setExtra.begin", "setExtra.end"}));
  pool.disableLog();
  EXPECT_EQ(out.take(), Lines{"disableLog.begin"});
}

TEST_F(SimpleAllocatorLog, RequirementQueries) {
  pool.enableLog();
  out.take();
  pool.freeStoreSize();
  EXPECT_EQ(out.take(), (Lines{"freeStoreSize.begin", "freeStoreSize.end"}));
  pool.usedStoreSize();
  EXPECT_EQ(out.take(), (Lines{"usedStoreSize.begin", "usedStoreSize.end"}));
  pool.freeStoreAvailableMemory();
  EXPECT_EQ(out.take(), (Lines{"freeStoreAvailableMemory.begin", "freeStoreAvailableMemory.end"}));
  pool.allocationCount();
  EXPECT_EQ(out.take(), (Lines{"allocationCount.begin", "allocationCount.end"}));
  pool.resetAllocationCount();
  EXPECT_EQ(out.take(),
            (Lines{"resetAllocationCount.begin", "resetAllocationCount():", "resetAllocationCount.end"}));
  pool.freeAllMemory();
  EXPECT_EQ(out.take(), (Lines{"freeAllMemory.begin", "freeAllMemory.end"}));
}

TEST_F(SimpleAllocatorLog, RequirementAllocation) {
  pool.enableLog();
  out.take();
  void* const a = pool.allocate(1000);
  EXPECT_EQ(out.take(),
            (Lines{"allocate.begin", "Alloc(1000):", " - freeStore.size = 0", " - usedStore.size = 0",
                   " - usedStorePtrs.size = 0", " - lowerBound valid = 0", " - upperBound valid = 0",
                   " - found no available allocation. Allocating new.", " - returning ptr = " + text(a),
                   "allocate.end"}));

  pool.deallocate(a);
  EXPECT_EQ(
      out.take(),
      (Lines{"deallocate.begin", "De-Alloc(" + text(a) + "):", " - before:", "  - freeStore.size = 0",
             "  - usedStore.size = 1", "  - usedStorePtrs.size = 1", " - after:", "  - freeStore.size = 1",
             "  - usedStore.size = 0", "  - usedStorePtrs.size = 0", "  - freeStore contents:",
             "   - Key = 1100, Value = " + text(a) + ", 1, 1000, 1100", "deallocate.end"}));

  pool.allocate(900);
  EXPECT_EQ(out.take(),
            (Lines{"allocate.begin", "Alloc(900):", " - freeStore.size = 1", " - usedStore.size = 0",
                   " - usedStorePtrs.size = 0", " - lowerBound valid = 0", " - upperBound valid = 1",
                   " - upperBound larger = 1", " - found allocation of larger size 1100. Re-using.",
                   " - returning ptr = " + text(a), "allocate.end"}));

  pool.deallocate(a);
  out.take();
  pool.allocate(1100);
  EXPECT_EQ(out.take(),
            (Lines{"allocate.begin", "Alloc(1100):", " - freeStore.size = 1", " - usedStore.size = 0",
                   " - usedStorePtrs.size = 0", " - lowerBound valid = 1", " - lowerBound smaller = 0",
                   " - upperBound valid = 0", " - found allocation of same size 1100. Re-using.",
                   " - returning ptr = " + text(a), "allocate.end"}));
}

TEST_F(SimpleAllocatorLog, RequirementGrowing) {
  pool.setExtra(0);
  void* const a = pool.allocate(100);
  pool.deallocate(a);
  pool.enableLog();
  out.take();
  FakeBulk::growth = FakeBulk::Growth::kAlways;
  pool.allocate(150);
  EXPECT_EQ(out.take(),
            (Lines{"allocate.begin", "Alloc(150):", " - freeStore.size = 1", " - usedStore.size = 0",
                   " - usedStorePtrs.size = 0", " - lowerBound valid = 1", " - lowerBound smaller = 1",
                   " - upperBound valid = 0", " - found allocation of smaller size 100. Re-using.",
                   "  - Re-alloc succeeded.", " - returning ptr = " + text(a), "allocate.end"}));

  pool.deallocate(a); // holds 166
  out.take();
  FakeBulk::growth = FakeBulk::Growth::kNever;
  void* const b = pool.allocate(249);
  auto const lines = out.take();
  ASSERT_EQ(lines.size(), 12u);
  EXPECT_EQ(lines[8], " - found allocation of smaller size 166. Re-using.");
  EXPECT_EQ(lines[9], "  - Re-alloc failed. Allocated new. Extra percentage required = 0.5");
  EXPECT_EQ(lines[10], " - returning ptr = " + text(b));
}

TEST_F(SimpleAllocatorLog, RequirementAgeing) {
  pool.setExtra(0);
  void* const a = pool.allocate(1000);
  void* const b = pool.allocate(2000);
  void* const c = pool.allocate(2001);
  for (void* block : {a, b, c}) pool.deallocate(block);
  pool.resetAllocationCount();
  pool.deallocate(pool.allocate(1500)); // b, count 1
  pool.deallocate(pool.allocate(2001)); // c, count 2
  pool.enableLog();
  out.take();
  pool.freeMemoryNotUsedSinceCount(1);
  EXPECT_EQ(out.take(),
            (Lines{"freeMemoryNotUsedSinceCount.begin", "freeMemoryNotUsedSinceCount(1):",
                   "Processing element: key = 1000, value = " + text(a) + ", 0, 0, 1000",
                   " - Freeing allocation with key 1000 because allocation count was less than 1",
                   "Processing element: key = 2000, value = " + text(b) + ", 1, 1500, 2000",
                   " - Re-allocating allocation with key 2000 because maxSize = 1500 and size = 2000",
                   "  - Re-alloc succeeded.",
                   "Processing element: key = 2001, value = " + text(c) + ", 2, 2001, 2001",
                   "freeMemoryNotUsedSinceCount.end"}));
}

TEST_F(SimpleAllocatorLog, RequirementTheEnd) {
  {
    SimpleAllocator quiet{FakeBulk::functions()};
    SimpleAllocator loud{FakeBulk::functions()};
    loud.enableLog();
    out.take();
  }
  EXPECT_EQ(out.take(), (Lines{"~SimpleAllocator.begin", "~SimpleAllocator.end"}));
}

} // namespace
