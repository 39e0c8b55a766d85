// Handles on one property object: what a write through one handle leaves untouched in the others.
#include "GeometryVolume/core/Object.h"
#include "support/CountedComponents.h"

#include <gtest/gtest.h>

#include <stdexcept>
#include <string>
#include <thread>
#include <utility>
#include <vector>

using namespace Support;
using Ostil::Any;
using Ostil::Ptr;

namespace {

VLN::Object sample() {
  VLN::Object o;
  o.addComponent(Ostil::makePtr<NumberComponent>("a", 1));
  o.addComponent(Ostil::makePtr<NumberComponent>("b", 2));
  o.setProperty("plain", Any(std::string("text")));
  return o;
}

} // namespace

// requirement
TEST(ObjectSharing, HandlesShareOneHostObject) {
  VLN::Object const a = sample();
  EXPECT_EQ(a.componentsUseCount(), 1);
  VLN::Object b = a;
  EXPECT_EQ(a.componentsUseCount(), 2);
  VLN::Object c;
  c = b;
  EXPECT_EQ(a.componentsUseCount(), 3);
  auto& self = c;
  c = self;
  EXPECT_EQ(a.componentsUseCount(), 3);
  c = VLN::Object();
  EXPECT_EQ(a.componentsUseCount(), 2);
  EXPECT_EQ(a.component("a").get(), b.component("a").get());
}

// regression: a moved-from handle is as good as before
TEST(ObjectSharing, MovingShares) {
  VLN::Object a = sample();
  VLN::Object b = std::move(a);
  EXPECT_EQ(a.size(), 3u);
  EXPECT_EQ(a.componentsUseCount(), 2);
  VLN::Object c;
  c = std::move(b);
  EXPECT_EQ(b.size(), 3u);
  EXPECT_TRUE(b.component("a"));
  b.eraseProperty("a");
  EXPECT_EQ(c.size(), 3u);
  EXPECT_EQ(b.size(), 2u);
  EXPECT_EQ(a.component("a").get(), c.component("a").get());
}

// requirement: what only the object holds is taken out, not copied
TEST(ObjectSharing, ExtractionCopiesOnlyWhatOthersHold) {
  VLN::Object a = sample();
  void const* const address = a.component("a").get();
  auto taken = a.extractComponent<NumberComponent>("a");
  EXPECT_EQ(taken.get(), address);
  EXPECT_FALSE(a.hasProperty("a"));
  void const* const second = a.component("b").get();
  VLN::Object const other = a;
  auto const copied = a.extractComponent("b");
  EXPECT_NE(copied.get(), second);
  EXPECT_EQ(other.component("b").get(), second);
  EXPECT_FALSE(a.hasProperty("b"));
}

// boundary
TEST(ObjectSharing, EraseThroughOneHandleLeavesTheOther) {
  VLN::Object const a = sample();
  VLN::Object b = a;
  EXPECT_TRUE(b.eraseProperty("a"));
  EXPECT_EQ(b.componentsUseCount(), 1);
  EXPECT_EQ(a.componentsUseCount(), 1);
  EXPECT_EQ(a.size(), 3u);
  EXPECT_EQ(b.size(), 2u);
  EXPECT_EQ(a.component("b").get(), b.component("b").get()) << "the components themselves are shared";
}

// requirement: each write operation separates
TEST(ObjectSharing, EveryWriteLeavesTheOtherHandleUnchanged) {
  using Write = void (*)(VLN::Object&);
  std::vector<Write> const writes = {
      [](VLN::Object& o) { o.addComponent(Ostil::makePtr<NumberComponent>("a", 9)); },
      [](VLN::Object& o) { o.putComponent(Ostil::makeMutable<NumberComponent>("new", 9)); },
      [](VLN::Object& o) { o.extractProperty("plain"); },
      [](VLN::Object& o) { o.eraseProperty("b"); },
      [](VLN::Object& o) { o.eraseAllProperties(); },
      [](VLN::Object& o) { o.clear(); },
      [](VLN::Object& o) { o.extractComponent("a"); },
      [](VLN::Object& o) { o.extractComponent<NumberComponent>("b"); },
      [](VLN::Object& o) { o.removeComponent("a"); },
      [](VLN::Object& o) { o.setProperty("x", Any(1)); },
  };
  for (std::size_t n = 0; n < writes.size(); ++n) {
    SCOPED_TRACE(n);
    VLN::Object const a = sample();
    VLN::Object b = a;
    writes[n](b);
    EXPECT_EQ(a.size(), 3u);
    EXPECT_EQ(a.component<NumberComponent>("a")->number(), 1);
    EXPECT_EQ(a.component<NumberComponent>("b")->number(), 2);
    EXPECT_EQ(*a.getProperty("plain").get<std::string>(), "text");
    EXPECT_EQ(b.componentsUseCount(), 1);
  }
}

// boundary
TEST(ObjectSharing, ExtractOfASharedComponentGivesACloneAndTheOtherKeepsIts) {
  VLN::Object const a = sample();
  VLN::Object b = a;
  auto const* const original = a.component("a").get();
  auto const taken = b.extractComponent("a");
  ASSERT_TRUE(taken);
  EXPECT_NE(taken.get(), original);
  EXPECT_EQ(taken->name(), "a");
  EXPECT_EQ(taken.useCount(), 1);
  EXPECT_EQ(a.component("a").get(), original);
  EXPECT_FALSE(b.hasProperty("a"));
}

// negative: a failing clone leaves the handle as it was
TEST(ObjectSharing, HandleSurvivesAFailingSeparation) {
  static bool s_fail = false;
  struct Fails {
    Fails() = default;
    Fails(Fails const&) {
      if (s_fail) throw std::runtime_error("no copy");
    }
    std::string text;
  };
  VLN::Object a;
  a.setProperty("fails", Any(Fails()));
  VLN::Object b = a;
  s_fail = true;
  EXPECT_THROW(b.eraseProperty("fails"), std::runtime_error);
  s_fail = false;
  ASSERT_EQ(b.componentsUseCount(), 2) << "the handle lost its object";
  EXPECT_EQ(b.size(), 1u);
  EXPECT_EQ(a.size(), 1u);
  EXPECT_TRUE(b.eraseProperty("fails"));
  EXPECT_EQ(a.size(), 1u);
}

// requirement
TEST(ObjectSharing, ThreadsMayWriteThroughHandlesOfTheirOwn) {
  VLN::Object const shared = sample();
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([own = shared, t]() mutable {
      for (int n = 0; n < 200; ++n) {
        VLN::Object local = own;
        local.addComponent(Ostil::makePtr<OtherComponent>("t" + std::to_string(t)));
        local.eraseProperty("plain");
        own.setProperty("n", Any(n));
      }
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(shared.size(), 3u);
}

// requirement: only components are copied, and deeply
TEST(ObjectCopy, CopiesComponentsAndDropsPlainProperties) {
  VLN::Object const a = sample();
  a.component("a")->setTargetName("b");
  Ptr<VLN::Object> copy;
  a.copyTo(copy);
  ASSERT_TRUE(copy);
  EXPECT_EQ(copy.useCount(), 1);
  EXPECT_EQ(copy->size(), 2u);
  EXPECT_FALSE(copy->hasProperty("plain"));
  EXPECT_NE(copy->component("a").get(), a.component("a").get());
  EXPECT_EQ(copy->component<NumberComponent>("a")->number(), 1);
  EXPECT_EQ(copy->component("a")->getTargetName(), "b");
  copy->component<NumberComponent>("a")->setNumber(7);
  EXPECT_EQ(a.component<NumberComponent>("a")->number(), 1);
}

// requirement
TEST(ObjectCopy, ReplacesWhatTheTargetHeld) {
  VLN::Object const a = sample();
  auto target = Ostil::makePtr<VLN::Object>();
  target->setProperty("old", Any(1));
  Ptr<VLN::Object> const old = target;
  a.copyTo(target);
  EXPECT_NE(target.get(), old.get());
  EXPECT_EQ(old.useCount(), 1);
  EXPECT_FALSE(target->hasProperty("old"));
  EXPECT_TRUE(old->hasProperty("old"));
}

// boundary
TEST(ObjectCopy, IntoItselfChangesNothing) {
  auto o = Ostil::makePtr<VLN::Object>(sample());
  auto const* const component = o->component("a").get();
  Ptr<VLN::Object> target = o;
  o->copyTo(target);
  EXPECT_EQ(target.get(), o.get());
  EXPECT_EQ(o->size(), 3u);
  EXPECT_EQ(o->component("a").get(), component);
}

// requirement: a component that copies to nothing is left out
TEST(ObjectCopy, LeavesOutComponentsThatMakeNoCopy) {
  struct Bare : VLN::Component {
    using Component::Component;
    std::uint64_t size() const override { return 0; }
    void update(VLN::Component const&) override {}
  };
  VLN::Object a;
  a.addComponent(Ostil::makePtr<Bare>("bare"));
  Ptr<VLN::Object> copy;
  a.copyTo(copy);
  EXPECT_TRUE(copy->empty());
}

// requirement: the clone of an object's block is a handle on the same host object
TEST(ObjectCopy, EmptyVolumeClonesAsAHandle) {
  Ptr<VLN::Object> const shared = VLN::createEmptyVLN();
  EXPECT_EQ(shared.useCount(), 1);
  EXPECT_TRUE(shared->empty());
  Ostil::MutablePtr<VLN::Object> const clone(shared);
  ASSERT_NE(clone.get(), shared.get());
  EXPECT_EQ(shared->componentsUseCount(), 2) << "both handles share the host object";
  clone->setProperty("x", Any(1));
  EXPECT_TRUE(shared->empty());
}
