// What the pool says when its log is on.
#include "ArrayPoolFixture.h"
#include "PoolScript.h"

#include <cstdlib>
#include <regex>
#include <sstream>

namespace {

using test::kMB;
using Lines = std::vector<std::string>;
namespace ArrayPool = test::ArrayPool;

std::string text(void const* p) {
  std::ostringstream os;
  os << p;
  return os.str();
}

class ArrayPoolLog : public test::ArrayPoolTest {
protected:
  ArrayPoolLog() {
    script.group.setFree(10 * kMB);
    ArrayPool::enableLog();
  }
  /// The lines so far, with the time that reading the figures took left out.
  Lines lines() {
    Lines result;
    for (auto const& line : script.out.take())
      result.push_back(
          std::regex_replace(line, std::regex("stats took [0-9.e+-]+ seconds$"), "stats took T seconds"));
    return result;
  }
  static Lines dumpOf(Lines const& entries, std::string const& total, std::string const& free = "10") {
    Lines result{"ArrayPool:Total physical memory = 64MB, available physical memory = " + free +
                     "MB. Retrieving stats took T seconds",
                 "ArrayPool:========================", "ArrayPool:Content of array pool:",
                 "ArrayPool:Total allocated memory : " + total + "MB", "ArrayPool:========================"};
    result.insert(result.end(), entries.begin(), entries.end());
    result.push_back("ArrayPool:========================");
    return result;
  }
  template <class... L> static Lines join(L const&... parts) {
    Lines all;
    (all.insert(all.end(), parts.begin(), parts.end()), ...);
    return all;
  }
  test::PoolScript script;
};

TEST_F(ArrayPoolLog, RequirementNothingIsSaidWhileItIsOff) {
  ArrayPool::disableLog();
  ArrayPool::enableRequiredFreeSize();
  ArrayPool::setRequiredFreeSize(20 * kMB);
  auto held = ArrayPool::allocate<float>(0, 100);
  held = ArrayPool::allocate<float>(0, 100);
  held.reset();
  ArrayPool::freeMemory(1);
  ArrayPool::freeMemoryNotUsedSinceCount(100);
  ArrayPool::freeAllMemory();
  ArrayPool::disableRequiredFreeSize();
  EXPECT_EQ(script.out.all(), "");
}

TEST_F(ArrayPoolLog, RequirementANewArray) {
  auto const array = ArrayPool::allocate<float>(0, 200000);
  std::string const entry = text(array.get()) + ": Array<float>: 0.762939MB, use_count = 2)";
  EXPECT_EQ(lines(),
            join(Lines{"ArrayPool: allocate.begin", "ArrayPool:allocate<float>( #200000 number of elements)",
                       "ArrayPool: Creating new array " + text(array.get()) +
                           " of type Ostil::Array<float>, and of size 0.762939MB and capacity 1MB",
                       "ArrayPool: Inserting into pool = 1"},
                 dumpOf({entry}, "1"), Lines{"ArrayPool: Stats after allocation.begin"}, dumpOf({entry}, "1"),
                 Lines{"ArrayPool: Stats after allocation.end", "ArrayPool: allocate.end"}));
}

TEST_F(ArrayPoolLog, RequirementReuse) {
  auto const used = ArrayPool::allocate<int>(0, 3);
  auto array = ArrayPool::allocate<int>(0, 5);
  std::string const address = text(array.get());
  array.reset();
  lines();
  array = ArrayPool::allocate<int>(0, 6);
  Lines all = lines();
  all.resize(6);
  EXPECT_EQ(all,
            (Lines{"ArrayPool: allocate.begin", "ArrayPool:allocate<int32>( #6 number of elements)",
                   "ArrayPool:Cannot re-use array because use_count = 2", "ArrayPool: Reusing array ",
                   "ArrayPool: Inserting into pool = 1",
                   address + " of type Ostil::Array<int32, size = 5, in_elementCount = 6, capacity = 8"}));
  array.reset();
  lines();
  array = ArrayPool::allocate<int>(0, 9);
  all = lines();
  ASSERT_GT(all.size(), 6u);
  EXPECT_EQ(all[3], "ArrayPool: Reallocating array ");
  EXPECT_EQ(all[5], address + " of type Ostil::Array<int32, size = 6, in_elementCount = 9, capacity = 8");
  EXPECT_EQ(all.back(), "ArrayPool: allocate.end");
}

TEST_F(ArrayPoolLog, RequirementDump) {
  ArrayPool::disableLog();
  auto const used = ArrayPool::allocate<int>(0, 100);
  auto const bytes = idle({1024});
  ArrayPool::dump();
  // Stores come in the order of the element types: 8-bit integers first.
  EXPECT_EQ(lines(), dumpOf({text(bytes[0]) + ": Array<uint8>: 0.000976562MB, use_count = 1)",
                             text(used.get()) + ": Array<int32>: 0.00038147MB, use_count = 2)"},
                            "0.00146484"));
  script.group.makeUnreadable();
  ArrayPool::dump();
  EXPECT_EQ(lines().front(), "ArrayPool:Unable to retrieve memory stats");
  ArrayPool::disable();
  lines();
  ArrayPool::dump();
  EXPECT_EQ(lines(), Lines{}) << "nothing while the pool is off";
}

TEST_F(ArrayPoolLog, RequirementFreeing) {
  ArrayPool::disableLog();
  idle({kMB, kMB, kMB});
  ArrayPool::enableLog();
  script.free("ArrayPool: removing ", 11).free("ArrayPool: removing ", 12.5);
  ArrayPool::freeMemory(2 * kMB);
  EXPECT_EQ(lines(),
            (Lines{"ArrayPool: freeMemory.begin",
                   "ArrayPool:freeMemory of 2MB",
                   "ArrayPool: Allocated = 3MB",
                   "ArrayPool: Available = 13MB",
                   "ArrayPool: Available physical = 10MB",
                   "ArrayPool:Attempting freeing of memory, try #1",
                   "ArrayPool: potentialRemoveMap.size() = 3",
                   "ArrayPool: removing 2 arrays of total size 2MB",
                   "ArrayPool: Enough physical memory is still not available: 11MB, need to try again...",
                   "ArrayPool:Attempting freeing of memory, try #2",
                   "ArrayPool: potentialRemoveMap.size() = 1",
                   "ArrayPool: removing 1 arrays of total size 1MB",
                   "ArrayPool: Enough physical memory is now available: 12.5MB",
                   "ArrayPool:OK: Enough physical memory now available (",
                   " Physical free = 12.5MB",
                   " Required free = 12MB",
                   "ArrayPool: Allocated = 0MB",
                   "ArrayPool: Available = 12.5MB",
                   "ArrayPool: Available physical = 12.5MB",
                   "ArrayPool: Available physical before = 10MB",
                   "ArrayPool: Requested total free amount = 2MB",
                   "ArrayPool: Satisfied free amount = 2.5MB",
                   "ArrayPool: freeMemory.end"}));
  ArrayPool::freeMemory(kMB);
  auto const all = lines();
  ASSERT_EQ(all.size(), 15u);
  EXPECT_EQ(all[5], "ArrayPool:Warning: NOT enough physical memory available (");
  EXPECT_EQ(all[6], " Physical free = 12.5MB");
  EXPECT_EQ(all[7], " Required free = 13.5MB");
}

TEST_F(ArrayPoolLog, RequirementRequiredSize) {
  ArrayPool::enableRequiredFreeSize();
  Lines const nothing = dumpOf({}, "0");
  auto const round = [&](std::string const& first, std::string const& size) {
    return join(
        Lines{first, "ArrayPool: freeRequiredMemory.begin", "freeRequiredMemory of " + size + "MB begin",
              "ArrayPool:Not necessary to free required memory: free physical memory = 10MB, required = " +
                  size + "MB",
              "freeRequiredMemory of " + size + "MB end"},
        nothing, Lines{"ArrayPool: freeRequiredMemory.end"});
  };
  EXPECT_EQ(lines(), round("ArrayPool:enableRequiredFreeSize", "0"));
  ArrayPool::enableRequiredFreeSize();
  EXPECT_EQ(lines(), Lines{}) << "on already";
  ArrayPool::setRequiredFreeSize(5 * kMB);
  EXPECT_EQ(lines(), round("ArrayPool:setRequiredFreeSize of 5MB", "5"));
  ArrayPool::addRequiredFreeSize(2 * kMB);
  EXPECT_EQ(lines(), round("ArrayPool:addRequiredFreeSize of 2MB", "7"));
  ArrayPool::subtractRequiredFreeSize(kMB);
  EXPECT_EQ(lines(), round("ArrayPool:addRequiredFreeSize of 1MB", "6"));
  ArrayPool::addRequiredFreeSize(5 * kMB);
  auto const all = lines();
  EXPECT_EQ(all[3], "ArrayPool: freeMemory.begin");
  EXPECT_EQ(all[4], "ArrayPool:freeMemory of 1MB");
  ArrayPool::disableRequiredFreeSize();
  EXPECT_EQ(lines(), Lines{"ArrayPool:disableRequiredFreeSize"});
  ArrayPool::setRequiredFreeSize(kMB);
  EXPECT_EQ(lines(), Lines{}) << "without effect";
}

TEST_F(ArrayPoolLog, RequirementOthers) {
  ArrayPool::freeMemoryNotUsedSinceCount(0);
  EXPECT_EQ(lines(), (Lines{"ArrayPool: freeMemoryNotUsedSinceCount.begin",
                            "ArrayPool: freeMemoryNotUsedSinceCount.end"}));
  ArrayPool::freeAllMemory();
  EXPECT_EQ(lines(), (Lines{"ArrayPool: freeAllMemory.begin", "ArrayPool: freeAllMemory.end"}));
  ArrayPool::disable();
  EXPECT_EQ(lines(), (Lines{"ArrayPool: freeAllMemory.begin", "ArrayPool: freeAllMemory.end"}));
  ArrayPool::disable();
  EXPECT_EQ(lines(), Lines{});
}

TEST(PoolUtilsLog, RequirementEachReadingPrintsOneLineWhenTheVariableIsSet) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  // The variable is read at load, so a process of its own is needed: death tests start one with our
  // environment.
  auto const readTwice = [] {
    std::cout.rdbuf(std::cerr.rdbuf());
    VLN::TileTree3D::PoolUtils::MemoryStats stats;
    VLN::TileTree3D::PoolUtils::getMemoryStats(stats);
    VLN::TileTree3D::PoolUtils::setCgroupPath("/nowhere at all");
    VLN::TileTree3D::PoolUtils::getMemoryStats(stats);
    std::_Exit(VLN::TileTree3D::PoolUtils::loggingEnabled() ? 3 : 4);
  };
  setenv("VELORN_ENABLE_VLN_POOL_UTILS_LOGGING", "1", 1);
  EXPECT_EXIT(readTwice(), ::testing::ExitedWithCode(3),
              "PoolUtils: total physical memory = [0-9.e+]+MB, available physical memory = [0-9.e+]+MB\n"
              "PoolUtils: unable to retrieve memory stats");
  setenv("VELORN_ENABLE_VLN_POOL_UTILS_LOGGING", "0", 1);
  EXPECT_EXIT(readTwice(), ::testing::ExitedWithCode(4), "");
  unsetenv("VELORN_ENABLE_VLN_POOL_UTILS_LOGGING");
}

TEST_F(ArrayPoolLog, RegressionAnArrayInUseIsListedAsItWasHandedOut) {
  auto array = ArrayPool::allocate<float>(0, kMB / 4);
  auto const entryAndTotal = [&] {
    lines();
    ArrayPool::dump();
    return lines();
  };
  std::string const entry = text(array.get()) + ": Array<float>: 1MB, use_count = ";
  EXPECT_EQ(entryAndTotal(), dumpOf({entry + "2)"}, "1"));
  // Its holder may do this at any time, also while the pool is being listed.
  array->resize(kMB);
  EXPECT_EQ(entryAndTotal(), dumpOf({entry + "2)"}, "1"));
  EXPECT_EQ(ArrayPool::allocatedMemory(), 4 * kMB);
  std::string const larger = text(array.get()) + ": Array<float>: 4MB, use_count = ";
  array.reset();
  EXPECT_EQ(entryAndTotal(), dumpOf({larger + "1)"}, "4"));
}

} // namespace
