#include "LoggerFixture.h"

#include "GeometryVolume/core/LoggerHooks.h"

#include <memory>
#include <sstream>
#include <vector>

namespace {

using test::Base;
using test::BaseLogger;
using test::block;
using test::LoggerTest;
using Lines = std::vector<std::string>;

std::string text(void const* p) {
  std::ostringstream os;
  os << p;
  return os.str();
}

TEST_F(LoggerTest, RequirementObjectsAreCounted) {
  {
    Base a("voxel_a");
    Base const b = a;
    a = b;
    EXPECT_EQ(counter("numAllocOK"), 2) << "a copy is a new object, an assignment is none";
  }
  EXPECT_EQ(counter("numDeAllocOK"), 2);
  EXPECT_EQ(counter("numAllocNotOK"), 0);
  EXPECT_EQ(counter("numDeAllocNotOK"), 0);
  EXPECT_EQ(out.all(), "");
}

TEST_F(LoggerTest, RequirementWhileOffNoHookChangesACounter) {
  Base const a("voxel_a");
  BaseLogger::pointerAllocated(block(1), &a);
  BaseLogger::pointerAllocated(block(2), &a);
  EXPECT_EQ(BaseLogger::numberOfActiveCopies("voxel_a"), 1);
  BaseLogger::disable();
  EXPECT_FALSE(BaseLogger::enabled());
  { Base const b("voxel_a"); }
  BaseLogger::pointerAllocated(block(3), &a);
  BaseLogger::pointerDeAllocated(block(9), &a);
  BaseLogger::pointerReAllocated(block(9), block(8));
  BaseLogger::clear();
  BaseLogger::clearCounters();
  EXPECT_EQ(BaseLogger::numberOfCopies(), 0);
  EXPECT_EQ(BaseLogger::numberOfActiveCopies(), 0);
  EXPECT_EQ(BaseLogger::numberOfActiveCopies("voxel_a"), 0);
  BaseLogger::enable();
  EXPECT_TRUE(BaseLogger::enabled());
  EXPECT_EQ(counter("numAllocOK"), 1);
  EXPECT_EQ(counter("numVoidAllocOK"), 2);
  EXPECT_EQ(counter("numVoidDeAllocNotOK"), 0);
  EXPECT_EQ(BaseLogger::numberOfActiveCopies("voxel_a"), 1) << "switching off kept the maps";
}

TEST_F(LoggerTest, NegativeAnObjectMadeWhileOffIsMissedAtItsEnd) {
  BaseLogger::disable();
  auto a = std::make_unique<Base>("early");
  BaseLogger::enable();
  a.reset();
  EXPECT_EQ(out.take(), Lines{"Warning: Base 'early' NOT deallocated OK"});
  EXPECT_EQ(counter("numDeAllocNotOK"), 1);
}

TEST_F(LoggerTest, NegativeAnObjectMissedAtItsEndIsThereAlready) {
  alignas(Base) unsigned char place[sizeof(Base)];
  auto* const a = new (place) Base("a");
  BaseLogger::disable();
  a->~Base();
  BaseLogger::enable();
  auto* const b = new (place) Base("b");
  EXPECT_EQ(counter("numAllocNotOK"), 1);
  b->~Base();
  EXPECT_EQ(counter("numDeAllocOK"), 1);
}

TEST_F(LoggerTest, RequirementOneBlockIsTheObjectItselfAndMoreAreCopies) {
  Base const a("voxel_a");
  EXPECT_EQ(BaseLogger::numberOfActiveCopies("voxel_a"), 0);
  BaseLogger::pointerAllocated(block(1), &a);
  EXPECT_EQ(BaseLogger::numberOfActiveCopies("voxel_a"), 0);
  BaseLogger::pointerAllocated(block(2), &a);
  EXPECT_EQ(BaseLogger::numberOfActiveCopies("voxel_a"), 1);
  EXPECT_EQ(BaseLogger::numberOfActiveCopies("other"), 0);
}

TEST_F(LoggerTest, RequirementSharedBlocksAreNoCopies) {
  int const before = BaseLogger::numberOfCopies();
  Base const a("voxel_a"), b("voxel_a"), c("voxel_a");
  BaseLogger::pointerAllocated(block(1), &a);
  BaseLogger::pointerAllocated(block(1), &b);
  EXPECT_EQ(BaseLogger::numberOfActiveCopies("voxel_a"), 0);
  EXPECT_EQ(BaseLogger::numberOfCopies(), before);
  BaseLogger::pointerAllocated(block(2), &c);
  EXPECT_EQ(BaseLogger::numberOfActiveCopies("voxel_a"), 1);
  EXPECT_EQ(counter("numVoidAllocOK"), 3);
  BaseLogger::pointerDeAllocated(block(1), &a);
  EXPECT_EQ(BaseLogger::numberOfActiveCopies("voxel_a"), 1);
  BaseLogger::pointerDeAllocated(block(1), &b);
  EXPECT_EQ(BaseLogger::numberOfActiveCopies("voxel_a"), 0);
}

TEST_F(LoggerTest, RequirementAnExtraCopyIsRegisteredAndTold) {
  int const before = BaseLogger::numberOfCopies();
  Base const a("voxel_a"), b("voxel_a");
  BaseLogger::pointerAllocated(block(1), &a);
  EXPECT_EQ(out.take(), Lines{});
  BaseLogger::pointerAllocated(block(2), &b);
  EXPECT_EQ(out.take(), Lines{"WARNING: Extra copy introduced for voxel_a"});
  EXPECT_EQ(BaseLogger::numberOfCopies(), before + 1);
}

TEST_F(LoggerTest, BoundaryWhichNamesAreWatched) {
  auto const warns = [&](std::string const& name) {
    BaseLogger::clear();
    Base const a(name), b(name);
    out.take();
    BaseLogger::pointerAllocated(block(1), &a);
    BaseLogger::pointerAllocated(block(2), &b);
    return out.take() == Lines{"WARNING: Extra copy introduced for " + name};
  };
  EXPECT_TRUE(warns("voxel_density"));
  EXPECT_TRUE(warns("level")) << "one of the letters is enough";
  EXPECT_TRUE(warns("_"));
  EXPECT_TRUE(warns("voxel_tile_tree_thread_local_2"));
  EXPECT_FALSE(warns("density"));
  EXPECT_FALSE(warns("a voxel"));
  EXPECT_FALSE(warns(""));
  EXPECT_FALSE(warns("voxel_tile_tree"));
  EXPECT_FALSE(warns("voxel_signed_distance"));
}

TEST_F(LoggerTest, RequirementTheSumOverAllNames) {
  Base const a("voxel_a"), b("level"), c("density"), tree("voxel_tile_tree"),
      scratch("voxel_tile_tree_thread_local"), pooled("channel_pool"), distance("voxel_signed_distance");
  int n = 1;
  for (Base const* base : {&a, &b, &c, &tree, &scratch, &pooled, &distance})
    for (int i = 0; i < 3; ++i) BaseLogger::pointerAllocated(block(n++), base);
  EXPECT_EQ(BaseLogger::numberOfActiveCopies("channel_pool"), 0) << "whatever is registered";
  EXPECT_EQ(BaseLogger::numberOfActiveCopies("voxel_tile_tree_thread_local"), 0);
  EXPECT_EQ(BaseLogger::numberOfActiveCopies("voxel_tile_tree"), 2);
  EXPECT_EQ(BaseLogger::numberOfActiveCopies("density"), 2);
  EXPECT_EQ(BaseLogger::numberOfActiveCopies(), 6) << "voxel_a, level and voxel_signed_distance";
}

TEST_F(LoggerTest, NegativeFreeingAnUnknownBlock) {
  Base const a("voxel_a"), b("voxel_a");
  BaseLogger::pointerDeAllocated(block(1), &a);
  EXPECT_EQ(out.take(), Lines{"pointerDeAllocated.1: DeAlloc Error"});
  BaseLogger::pointerAllocated(block(1), &a);
  BaseLogger::pointerDeAllocated(block(1), &b);
  EXPECT_EQ(out.take(), Lines{"pointerDeAllocated.2: DeAlloc Error"});
  EXPECT_EQ(counter("numVoidDeAllocNotOK"), 2);
  BaseLogger::pointerDeAllocated(block(1), &a);
  EXPECT_EQ(counter("numVoidDeAllocOK"), 1);
  EXPECT_EQ(out.take(), Lines{});
}

TEST_F(LoggerTest, RequirementReallocationKeepsTheOwners) {
  Base const a("voxel_a"), b("voxel_a");
  BaseLogger::pointerAllocated(block(1), &a);
  BaseLogger::pointerAllocated(block(1), &b);
  BaseLogger::pointerReAllocated(block(1), block(2));
  EXPECT_EQ(counter("numVoidDeAllocOK"), 1);
  EXPECT_EQ(counter("numVoidAllocOK"), 3);
  BaseLogger::pointerDeAllocated(block(2), &a);
  BaseLogger::pointerDeAllocated(block(2), &b);
  EXPECT_EQ(counter("numVoidDeAllocOK"), 3);
  EXPECT_EQ(counter("numVoidDeAllocNotOK"), 0);
  BaseLogger::pointerReAllocated(block(1), block(3));
  EXPECT_EQ(counter("numVoidDeAllocNotOK"), 1) << "unknown";
  EXPECT_EQ(counter("numVoidAllocOK"), 3);
}

TEST_F(LoggerTest, NegativeReallocationOntoAKnownBlock) {
  Base const a("voxel_a");
  BaseLogger::pointerAllocated(block(1), &a);
  BaseLogger::pointerAllocated(block(2), &a);
  BaseLogger::pointerReAllocated(block(1), block(2));
  EXPECT_EQ(counter("numVoidAllocNotOK"), 1);
  EXPECT_EQ(counter("numVoidDeAllocOK"), 1);
}

TEST_F(LoggerTest, RequirementTheTracedName) {
  BaseLogger::setTracedName("voxel_a");
  Base const a("voxel_a"), b("voxel_a"), other("voxel_b");
  BaseLogger::pointerAllocated(block(1), &a);
  EXPECT_EQ(out.take(), (Lines{"Copy for voxel_a: " + text(block(1)), "pointerAllocated.1: voxel_a"}));
  BaseLogger::pointerAllocated(block(1), &b);
  Lines lines = out.take();
  ASSERT_EQ(lines.size(), 4u);
  EXPECT_EQ(lines[2], "Copy for voxel_a: " + text(block(1)));
  EXPECT_EQ(lines[3], "pointerAllocated.2 voxel_a");
  BaseLogger::pointerAllocated(block(2), &b);
  lines = out.take();
  ASSERT_EQ(lines.size(), 8u);
  EXPECT_EQ(lines[5], "WARNING: Extra copy introduced for voxel_a");
  EXPECT_EQ(lines[6], "pointerAllocated.1: voxel_a");
  EXPECT_EQ(lines[7], "Extra copy introduced");
  BaseLogger::pointerDeAllocated(block(1), &a);
  EXPECT_EQ(out.take(), Lines{"pointerDeAllocated.4: voxel_a"});
  BaseLogger::pointerDeAllocated(block(1), &b);
  EXPECT_EQ(out.take(), Lines{"pointerDeAllocated.3: voxel_a"});
  BaseLogger::pointerAllocated(block(5), &other);
  BaseLogger::pointerDeAllocated(block(5), &other);
  EXPECT_EQ(out.take(), Lines{}) << "of other names nothing is told";
}

TEST_F(LoggerTest, RequirementClearing) {
  auto const a = std::make_unique<Base>("voxel_a");
  BaseLogger::pointerAllocated(block(1), a.get());
  BaseLogger::pointerAllocated(block(2), a.get());
  BaseLogger::clearCounters();
  EXPECT_EQ(counter("numAllocOK"), 0);
  EXPECT_EQ(BaseLogger::numberOfActiveCopies("voxel_a"), 1) << "the maps stay";
  BaseLogger::clear();
  EXPECT_EQ(BaseLogger::numberOfActiveCopies("voxel_a"), 0);
  BaseLogger::pointerDeAllocated(block(1), a.get());
  EXPECT_EQ(counter("numVoidDeAllocNotOK"), 1);
}

TEST_F(LoggerTest, RequirementOnlyTheReportIsADumpInProgress) {
  struct Asking : Base {
    using Base::Base;
    void memUse(std::uint64_t& used, std::uint64_t& allocated, bool) const override {
      used = allocated = 1;
      seen = BaseLogger::isDumpInProgress() && VLN::loggerDumpInProgress();
    }
    mutable bool seen = false;
  } const asking("asking");
  EXPECT_FALSE(BaseLogger::isDumpInProgress());
  BaseLogger::dump();
  EXPECT_TRUE(asking.seen);
  EXPECT_FALSE(BaseLogger::isDumpInProgress());
  BaseLogger::disable();
  BaseLogger::dump();
  EXPECT_FALSE(asking.seen) << "never while the logger is off";
}

TEST_F(LoggerTest, RequirementObjectsBeingMadeOrDestroyedAreNotAskedForTheirSize) {
  struct Slow : test::Sized {
    Slow()
        : Sized("slow", std::uint64_t(64) << 20, std::uint64_t(64) << 20) {
      VLN::objectIncomplete(this);
    }
  } slow;
  auto const size = [&] {
    test::CoutCapture report;
    BaseLogger::dump();
    return report.after("Total mem occupied by data: used = ");
  };
  std::string const small = size();
  EXPECT_FALSE(small.starts_with("64MB")) << small;
  VLN::objectComplete(&slow);
  EXPECT_EQ(size(), "64MB (allocated = 64)");
  VLN::objectIncomplete(&slow);
  EXPECT_EQ(size(), small);
}

} // namespace
