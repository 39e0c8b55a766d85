// The host's type-erased value: the six requests of its manager, for values inside it and on the heap.
#include "Ostil/Any.h"
#include "Ostil/Ptr.h"
#include "support/CountedComponents.h"

#include <gtest/gtest.h>

#include <array>
#include <stdexcept>
#include <string>

using Ostil::Any;

namespace {

struct Counts {
  int made = 0, copied = 0, moved = 0, destroyed = 0;
};

/// Counts what happens to it; `Padding` decides whether it fits inside an Any.
template <std::size_t Padding> struct Tracked {
  explicit Tracked(Counts& c)
      : counts(&c) {
    ++counts->made;
  }
  Tracked(Tracked const& b)
      : counts(b.counts) {
    ++counts->copied;
  }
  Tracked(Tracked&& b) noexcept
      : counts(b.counts) {
    ++counts->moved;
  }
  ~Tracked() { ++counts->destroyed; }
  Counts* counts;
  std::array<char, Padding> padding{};
};
using Small = Tracked<1>;
using Large = Tracked<100>;

template <class T> class AnyOf : public ::testing::Test {};
using Sizes = ::testing::Types<Small, Large>;
TYPED_TEST_SUITE(AnyOf, Sizes);

} // namespace

// requirement
TEST(Any, EmptyHoldsNothing) {
  Any const a;
  EXPECT_TRUE(a.empty());
  EXPECT_FALSE(a);
  EXPECT_EQ(a.get<int>(), nullptr);
  EXPECT_TRUE(a.type() == typeid(void));
  Any const copy = a;
  EXPECT_TRUE(copy.empty());
  Any moved = Any();
  EXPECT_TRUE(moved.empty());
  moved.clear();
  EXPECT_TRUE(moved.empty());
}

// requirement: addresses are given for the held type only, and its token is told
TYPED_TEST(AnyOf, TellsItsTypeAndGivesTheAddressForItOnly) {
  Counts counts;
  Any a = TypeParam(counts);
  ASSERT_NE(a.get<TypeParam>(), nullptr);
  EXPECT_EQ(a.get<TypeParam>()->counts, &counts);
  EXPECT_EQ(a.get<int>(), nullptr);
  EXPECT_EQ(std::as_const(a).get<std::string>(), nullptr);
  EXPECT_TRUE(a.type() == typeid(TypeParam));
}

// requirement
TYPED_TEST(AnyOf, AddressIsGivenUncheckedToo) {
  Counts counts;
  Any a = TypeParam(counts);
  EXPECT_EQ(a.address(), static_cast<void*>(a.get<TypeParam>()));
  EXPECT_EQ(std::as_const(a).address(), static_cast<void const*>(a.get<TypeParam>()));
  EXPECT_EQ(Any().address(), nullptr);
}

// requirement
TYPED_TEST(AnyOf, CopyMakesASecondValue) {
  Counts counts;
  {
    Any const a = TypeParam(counts);
    int const copied = counts.copied;
    Any const b = a;
    EXPECT_EQ(counts.copied, copied + 1);
    EXPECT_NE(a.get<TypeParam>(), b.template get<TypeParam>());
    EXPECT_FALSE(a.empty());
  }
  EXPECT_EQ(counts.destroyed, counts.made + counts.copied + counts.moved);
}

// requirement
TYPED_TEST(AnyOf, MoveLeavesTheSourceEmpty) {
  Counts counts;
  {
    Any a = TypeParam(counts);
    int const copied = counts.copied;
    Any const b = std::move(a);
    EXPECT_EQ(counts.copied, copied);
    EXPECT_TRUE(a.empty()); // NOLINT: moved from
    ASSERT_NE(b.get<TypeParam>(), nullptr);
  }
  EXPECT_EQ(counts.destroyed, counts.made + counts.copied + counts.moved);
}

// requirement
TYPED_TEST(AnyOf, AssignmentDestroysWhatWasHeld) {
  Counts first, second;
  {
    Any a = TypeParam(first);
    int const before = first.destroyed;
    a = Any(TypeParam(second));
    EXPECT_EQ(first.destroyed, before + 1);
    EXPECT_EQ(a.get<TypeParam>()->counts, &second);
    auto& self = a;
    a = self;
    ASSERT_NE(a.get<TypeParam>(), nullptr);
    EXPECT_EQ(a.get<TypeParam>()->counts, &second);
    a.clear();
    EXPECT_TRUE(a.empty());
  }
  EXPECT_EQ(second.destroyed, second.made + second.copied + second.moved);
}

// requirement: the one kind of value that the object model stores
TEST(Any, HoldsComponentPointersByReference) {
  using Held = Ostil::Ptr<VLN::Component>;
  Held const c = Ostil::makePtr<Support::NumberComponent>("n", 4);
  {
    Any a = c;
    EXPECT_EQ(c.useCount(), 2);
    Any const copy = a;
    EXPECT_EQ(c.useCount(), 3);
    EXPECT_EQ(copy.get<Held>()->get(), c.get());
    Any const moved = std::move(a);
    EXPECT_EQ(c.useCount(), 3);
    EXPECT_EQ(moved.get<Ostil::Ptr<Support::NumberComponent>>(), nullptr) << "the type is exact";
  }
  EXPECT_EQ(c.useCount(), 1);
}

// negative
TEST(Any, FailedCopyLeavesTheTargetEmpty) {
  struct Fails {
    Fails() = default;
    Fails(Fails const&) { throw std::runtime_error("no copy"); }
    Fails(Fails&&) noexcept {}
    std::array<char, 64> padding{};
  };
  Any const a = Fails();
  EXPECT_THROW(Any{a}, std::runtime_error);
  EXPECT_FALSE(a.empty());
}

// requirement
TEST(Any, HoldsStringsAndArrays) {
  Any a = std::string(1000, 'x');
  Any b = a;
  a.get<std::string>()->assign("changed");
  EXPECT_EQ(b.get<std::string>()->size(), 1000u);
  std::swap(a, b);
  EXPECT_EQ(b.get<std::string>()->size(), 7u);
}
