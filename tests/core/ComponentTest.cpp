// Base and Component: names, dumps, memory figures, registration.
#include "GeometryVolume/core/Component.h"
#include "GeometryVolume/core/LoggerHooks.h"
#include "GeometryVolume/core/Streaming.h"
#include "support/CountedComponents.h"

#include <gtest/gtest.h>

#include <sstream>
#include <string>
#include <vector>

using namespace Support;
using Ostil::Ptr;

namespace {

struct OpenBase : VLN::Base {
  using Base::Base;
  using Base::copyTo;
};

/// Copies as VLN::Component itself does.
struct PlainComponent : VLN::Component {
  using Component::Component;
  PlainComponent() = default;
  std::uint64_t size() const override { return 3; }
  void update(VLN::Component const&) override {}
};

} // namespace

// requirement
TEST(Base, CarriesAName) {
  OpenBase a("first"), b;
  EXPECT_EQ(a.name(), "first");
  EXPECT_EQ(b.name(), "");
  OpenBase const copy(a);
  EXPECT_EQ(copy.name(), "first");
  b.setName("second");
  b = a;
  EXPECT_EQ(b.name(), "first");
  a.setName("third");
  a.copyTo(b);
  EXPECT_EQ(b.name(), "third");
  a.copyTo(a);
  EXPECT_EQ(a.name(), "third");
}

// requirement
TEST(Base, DumpWritesPadNameAndAnEmptyLine) {
  OpenBase const a("volume");
  std::ostringstream os;
  a.dump(os);
  EXPECT_EQ(os.str(), "name = volume\n\n");
  std::ostringstream padded;
  VLN::Streaming::setPadWidth(padded, 2);
  VLN::Streaming::incIndent(padded, 2);
  a.dump(padded);
  EXPECT_EQ(padded.str(), "    name = volume\n\n");
}

// requirement: outputs are overwritten
TEST(Base, MemUseIsTheSizeOfABase) {
  std::uint64_t used = 77, allocated = 88;
  OpenBase("x").memUse(used, allocated, false);
  EXPECT_EQ(used, sizeof(VLN::Base));
  EXPECT_EQ(allocated, sizeof(VLN::Base));
}

// requirement
TEST(Component, MemUseAddsAString) {
  std::uint64_t used = 77, allocated = 88;
  PlainComponent("x").memUse(used, allocated, true);
  EXPECT_EQ(used, sizeof(VLN::Base) + sizeof(Ostil::String));
  EXPECT_EQ(allocated, used);
}

// requirement
TEST(Component, DumpAddsSizeAndAddress) {
  PlainComponent const c("x");
  std::ostringstream os, address;
  VLN::Streaming::setPadWidth(os, 1);
  VLN::Streaming::incIndent(os, 1);
  c.dump(os);
  address << static_cast<void const*>(&c);
  EXPECT_EQ(os.str(), " name = x\n\n size = 3\n address = " + address.str() + "\n\n");
}

// requirement
TEST(Component, CopiesCarryNameAndTargetName) {
  PlainComponent a("a"), b("b");
  a.setTargetName("t");
  PlainComponent const copy(a);
  EXPECT_EQ(copy.name(), "a");
  EXPECT_EQ(copy.getTargetName(), "t");
  b = a;
  EXPECT_EQ(b.name(), "a");
  EXPECT_EQ(b.getTargetName(), "t");
  auto& self = b;
  b = self;
  EXPECT_EQ(b.getTargetName(), "t");
  b.clear();
  EXPECT_EQ(b.getTargetName(), "");
  EXPECT_EQ(b.name(), "a");
}

// requirement
TEST(Component, CopyToWritesBothNamesIntoTheTarget) {
  PlainComponent a("a");
  a.setTargetName("t");
  Ptr<VLN::Component> target = Ostil::makePtr<PlainComponent>("other");
  auto const* const object = target.get();
  a.copyTo(target);
  EXPECT_EQ(target.get(), object);
  EXPECT_EQ(target.useCount(), 1);
  EXPECT_EQ(target->name(), "a");
  EXPECT_EQ(target->getTargetName(), "t");
}

// boundary
TEST(Component, CopyToReturnsForItselfAndForAnEmptyTarget) {
  auto const a = Ostil::makePtr<PlainComponent>("a");
  Ptr<VLN::Component> self = a;
  a->copyTo(self);
  EXPECT_EQ(self.get(), a.get());
  Ptr<VLN::Component> none;
  a->copyTo(none);
  EXPECT_FALSE(none);
}

// requirement
TEST(Component, IsEmptyWhenItsSizeIsZero) {
  EXPECT_TRUE(NumberComponent("x", 0).empty());
  EXPECT_FALSE(NumberComponent("x", 1).empty());
}

namespace {

std::vector<std::pair<char, VLN::Base const*>> g_registered;

} // namespace

// requirement: every construction registers, every destruction signs off, assignment does neither
TEST(Base, RegistersWithTheLoggerWhileOneIsInstalled) {
  static constexpr VLN::LoggerHooks hooks{
      [](VLN::Base const* b) { g_registered.emplace_back('+', b); },
      [](VLN::Base const* b) { g_registered.emplace_back('-', b); },
      [](void const*, VLN::Base const*) { g_registered.emplace_back('a', nullptr); },
      [](void const*, VLN::Base const*) { g_registered.emplace_back('d', nullptr); },
      [](void const*, void const*) { g_registered.emplace_back('r', nullptr); },
      [] { return true; }};
  EXPECT_FALSE(VLN::loggingEnabled());
  EXPECT_FALSE(VLN::loggerDumpInProgress());
  VLN::pointerAllocated(nullptr, nullptr);
  g_registered.clear();
  VLN::Internal::g_loggerHooks.storeRelease(&hooks);
  VLN::Base const *first = nullptr, *second = nullptr, *third = nullptr;
  {
    OpenBase a("a");
    OpenBase b(a);
    OpenBase c;
    first = &a, second = &b, third = &c;
    c = a;
    VLN::pointerAllocated(&a, &a);
    VLN::pointerReAllocated(&a, &b);
    VLN::pointerDeAllocated(&a, &a);
    EXPECT_TRUE(VLN::loggingEnabled());
    EXPECT_TRUE(VLN::loggerDumpInProgress());
  }
  VLN::Internal::g_loggerHooks.storeRelease(nullptr);
  using Events = decltype(g_registered);
  EXPECT_EQ(g_registered, (Events{{'+', first},
                                  {'+', second},
                                  {'+', third},
                                  {'a', nullptr},
                                  {'r', nullptr},
                                  {'d', nullptr},
                                  {'-', third},
                                  {'-', second},
                                  {'-', first}}));
}
