// The host's shared pointers: counts, sole ownership, clones, casts.
#include "Ostil/Ptr.h"
#include "support/CountedComponents.h"

#include <gtest/gtest.h>

#include <string>
#include <thread>
#include <vector>

using namespace Support;
using Ostil::MutablePtr;
using Ostil::Ptr;

namespace {

/// Records the order in which its operations are called.
struct RecordingBlock final : Ostil::ControlBlock {
  RecordingBlock(std::string& events, int* object)
      : log(events)
      , owned(object) {}
  void clone(void const* held, void*& outObject, Ostil::ControlBlock*& outBlock) const override {
    log += "clone ";
    auto* copy = new int(*static_cast<int const*>(held));
    outObject = copy;
    outBlock = new RecordingBlock(log, copy);
  }
  void destroy() override {
    log += "destroy" + std::to_string(*owned) + ' ';
    delete owned;
    delete this;
  }
  std::string& log;
  int* owned;
};

Ptr<int> recorded(std::string& events, int value) {
  auto* object = new int(value);
  return Ptr<int>(object, new RecordingBlock(events, object));
}

} // namespace

// requirement
TEST(Ptr, NewBlocksStartAtOneOwner) {
  auto const p = Ostil::makePtr<int>(7);
  EXPECT_EQ(p.useCount(), 1);
  EXPECT_TRUE(p.unique());
  EXPECT_EQ(*p, 7);
  EXPECT_EQ(Ptr<int>().useCount(), 0);
  EXPECT_FALSE(Ptr<int>());
  EXPECT_TRUE(Ptr<int>() == nullptr);
}

// requirement
TEST(Ptr, CopiesCountAndMovesDoNot) {
  auto a = Ostil::makePtr<int>(7);
  Ptr<int> b = a;
  EXPECT_EQ(a.useCount(), 2);
  EXPECT_TRUE(a == b);
  Ptr<int> c = std::move(a);
  EXPECT_EQ(c.useCount(), 2);
  EXPECT_FALSE(a); // NOLINT: moved from
  EXPECT_EQ(a.useCount(), 0);
  b = c;
  EXPECT_EQ(c.useCount(), 2);
  auto& self = c;
  c = self;
  EXPECT_EQ(c.useCount(), 2);
  b.reset();
  EXPECT_EQ(c.useCount(), 1);
}

// requirement: a sole owner's pair is taken over
TEST(Ptr, ConversionToMutableTakesASoleOwnersPair) {
  std::string events;
  {
    auto p = recorded(events, 1);
    int* const object = p.get();
    MutablePtr<int> m(std::move(p));
    EXPECT_EQ(m.get(), object);
    EXPECT_EQ(m.useCount(), 1);
    EXPECT_EQ(events, "");
  }
  EXPECT_EQ(events, "destroy1 ");
}

// requirement: a shared object is cloned, then the reference on it is dropped
TEST(Ptr, ConversionToMutableClonesASharedObject) {
  std::string events;
  {
    auto p = recorded(events, 1);
    MutablePtr<int> m(p);
    EXPECT_EQ(events, "clone ");
    EXPECT_EQ(p.useCount(), 1);
    EXPECT_EQ(m.useCount(), 1);
    EXPECT_NE(m.get(), p.get());
    *m = 2;
    EXPECT_EQ(*p, 1);
    m = nullptr;
    EXPECT_EQ(events, "clone destroy2 ");
  }
  EXPECT_EQ(events, "clone destroy2 destroy1 ");
}

// requirement
TEST(Ptr, ConversionOfNullIsNull) {
  MutablePtr<int> const m{Ptr<int>()};
  EXPECT_FALSE(m);
  EXPECT_EQ(m.useCount(), 0);
}

// requirement: the address of a base class inside the object survives the clone
TEST(Ptr, CloneKeepsTheOffsetOfTheHeldBase) {
  auto whole = Ostil::makePtr<ShiftedComponent>("shifted", 12);
  Ptr<VLN::Component> base = whole;
  ASSERT_NE(static_cast<void*>(base.get()), static_cast<void*>(whole.get()))
      << "the test needs a base that is not first";
  MutablePtr<VLN::Component> own(base);
  ASSERT_NE(own.get(), base.get());
  EXPECT_EQ(own->name(), "shifted");
  EXPECT_EQ(own->size(), 12u);
  auto* copy = dynamic_cast<ShiftedComponent*>(own.get());
  ASSERT_NE(copy, nullptr);
  EXPECT_NE(copy, whole.get());
  EXPECT_EQ(copy->weight[4], 5u);
  EXPECT_EQ(reinterpret_cast<char*>(own.get()) - reinterpret_cast<char*>(copy),
            reinterpret_cast<char*>(base.get()) - reinterpret_cast<char*>(whole.get()));
}

// requirement
TEST(Ptr, CastsShareTheBlockAndKeepTheObject) {
  auto shifted = Ostil::makePtr<ShiftedComponent>("shifted", 3);
  Ptr<VLN::Component> const base = shifted;
  auto const down = Ostil::dynamicCast<ShiftedComponent>(base);
  EXPECT_EQ(down.get(), shifted.get());
  EXPECT_EQ(shifted.useCount(), 3);
  EXPECT_FALSE(Ostil::dynamicCast<OtherComponent>(base));
  EXPECT_EQ(shifted.useCount(), 3);
  EXPECT_FALSE(Ostil::dynamicCast<OtherComponent>(Ptr<VLN::Component>()));

  Ptr<void> const erased = shifted;
  EXPECT_EQ(shifted.useCount(), 4);
  EXPECT_EQ(Ostil::staticCast<ShiftedComponent>(erased).get(), shifted.get());
}

// requirement
TEST(Ptr, MutableConvertsToASharedPointerOfABase) {
  auto own = Ostil::makeMutable<ShiftedComponent>("shifted", 3);
  auto* const object = own.get();
  MutablePtr<NumberComponent> narrower = std::move(own);
  EXPECT_EQ(own.get(), nullptr); // NOLINT: moved from
  EXPECT_EQ(narrower.get(), static_cast<NumberComponent*>(object));
  Ptr<VLN::Component> const shared = std::move(narrower);
  EXPECT_EQ(shared.useCount(), 1);
  EXPECT_EQ(shared->size(), 3u);
}

// negative
TEST(Ptr, CloningWhatCannotBeCopiedThrowsAndKeepsTheOthersReference) {
  struct Uncopyable {
    Uncopyable() = default;
    Uncopyable(Uncopyable const&) = delete;
  };
  auto p = Ostil::makePtr<Uncopyable>();
  EXPECT_THROW(MutablePtr<Uncopyable>{p}, std::logic_error);
  EXPECT_EQ(p.useCount(), 1);
}

// requirement
TEST(Ptr, ObjectsDieWithTheLastOwner) {
  int const before = NumberComponent::live();
  {
    auto a = Ostil::makePtr<NumberComponent>("a");
    Ptr<VLN::Component> b = a;
    a.reset();
    EXPECT_EQ(NumberComponent::live(), before + 1);
    MutablePtr<VLN::Component> c(std::move(b));
    EXPECT_EQ(NumberComponent::live(), before + 1);
  }
  EXPECT_EQ(NumberComponent::live(), before);
}

// requirement: counts are atomic
TEST(Ptr, ThreadsMayCopyAndDropOneObject) {
  auto const shared = Ostil::makePtr<int>(1);
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([shared] {
      for (int n = 0; n < 20000; ++n) Ptr<int> const copy = shared;
    });
  }
  for (auto& thread : threads) thread.join();
  threads.clear();
  EXPECT_EQ(shared.useCount(), 1);
}
