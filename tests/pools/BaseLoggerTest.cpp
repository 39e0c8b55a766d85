#include "LoggerFixture.h"

#include "GeometryVolume/core/LoggerHooks.h"

#include <memory>
#include <sstream>
#include <thread>
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

/// Makes and drops objects, with blocks and new names, while it is asked for its size.
class Busy final : public Base {
public:
  Busy()
      : Base("busy") {}
  void memUse(std::uint64_t& used, std::uint64_t& allocated, bool) const override {
    for (int n = 0; n < 100; ++n) {
      Base other("voxel_other" + std::to_string(n));
      BaseLogger::pointerAllocated(test::block(n + 1), &other);
      other.setName("renamed");
      BaseLogger::numberOfActiveCopies();
      BaseLogger::pointerDeAllocated(test::block(n + 1), &other);
    }
    if (!m_kept) m_kept = std::make_unique<Base>("kept");
    used = allocated = std::uint64_t(32) << 20;
  }

private:
  mutable std::unique_ptr<Base> m_kept;
};

TEST_F(LoggerTest, RegressionObjectsThatMakeOthersToMeasureThemselves) {
  Busy const busy;
  BaseLogger::dump();
  EXPECT_EQ(out.after("Total mem occupied by data: used = ").substr(0, 4), "32MB");
  EXPECT_EQ(out.count("pointerDeAllocated"), 0);
  EXPECT_EQ(out.count("Warning"), 0);
  out.take();
  EXPECT_EQ(counter("numDeAllocNotOK"), 0);
  BaseLogger::dump();
  EXPECT_NE(out.all().find("base = kept, #shallow copies (incl orig) = 1"), std::string::npos) << out.all();
}

TEST_F(LoggerTest, RegressionObjectsThatDieWhileTheLoggerIsOffAreForgotten) {
  auto gone = std::make_unique<test::Sized>("gone", 1000, 1000);
  auto renamed = std::make_unique<Base>("before");
  BaseLogger::pointerAllocated(test::block(1), gone.get());
  BaseLogger::disable();
  EXPECT_FALSE(BaseLogger::enabled());
  BaseLogger::pointerDeAllocated(test::block(1), gone.get());
  gone.reset();
  renamed->setName("after");
  Base const unseen("unseen");
  BaseLogger::enable();
  out.take();
  BaseLogger::dump();
  std::string const report = out.all();
  EXPECT_EQ(report.find("base = gone"), std::string::npos);
  EXPECT_EQ(report.find("base = unseen"), std::string::npos);
  EXPECT_NE(report.find("base = after"), std::string::npos);
  EXPECT_EQ(out.after(" numDeAllocOK = "), "0") << "nothing is counted while it is off";
  BaseLogger::pointerDeAllocated(test::block(1), renamed.get());
  EXPECT_EQ(out.count("pointerDeAllocated.1: DeAlloc Error"), 1) << "the block went as well";
}

TEST_F(LoggerTest, RegressionAnotherThreadsObjectIsMeasuredOnceItIsComplete) {
  test::Sized const mine("mine", std::uint64_t(16) << 20, std::uint64_t(16) << 20);
  test::Sized announced("announced", std::uint64_t(8) << 20, std::uint64_t(8) << 20);
  VLN::objectComplete(&announced);
  std::thread([] { BaseLogger::dump(); }).join();
  std::string const elsewhere = out.after("Total mem occupied by data: used = ");
  EXPECT_TRUE(elsewhere.starts_with("8")) << elsewhere;
  out.take();
  BaseLogger::dump();
  EXPECT_TRUE(out.after("Total mem occupied by data: used = ").starts_with("24"));
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
