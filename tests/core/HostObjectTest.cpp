// The host's property object, its array, and its path functions.
#include "Ostil/Array.h"
#include "Ostil/Job.h"
#include "Velorn/FileUtils.h"
#include "Velorn/Math.h"
#include "Velorn/Object.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <limits>
#include <string>
#include <vector>

using Ostil::Any;

namespace {

std::vector<std::string> keysOf(Velorn::Object const& object) {
  auto const keys = object.keys();
  return {keys->begin(), keys->end()};
}

} // namespace

// requirement
TEST(HostObject, StartsEmpty) {
  auto const o = Velorn::createObject();
  EXPECT_EQ(o.useCount(), 1);
  EXPECT_TRUE(o->empty());
  EXPECT_EQ(o->size(), 0u);
  EXPECT_TRUE(keysOf(*o).empty());
  EXPECT_FALSE(o->hasProperty(""));
}

// negative
TEST(HostObject, AbsentKeysGiveQuietAnswers) {
  auto const o = Velorn::createObject();
  o->setProperty("a", Any(1));
  EXPECT_FALSE(o->hasProperty("b"));
  EXPECT_TRUE(o->getProperty("b").empty());
  EXPECT_TRUE(o->extractProperty("b").empty());
  EXPECT_FALSE(o->eraseProperty("b"));
  EXPECT_EQ(o->size(), 1u);
}

// requirement
TEST(HostObject, KeysKeepTheOrderOfInsertionAndReplacingKeepsThePlace) {
  auto const o = Velorn::createObject();
  for (char const* key : {"zebra", "apple", "middle", "beta"}) o->setProperty(key, Any(std::string(key)));
  o->setProperty("apple", Any(5));
  EXPECT_EQ(keysOf(*o), (std::vector<std::string>{"zebra", "apple", "middle", "beta"}));
  EXPECT_EQ(*o->getProperty("apple").get<int>(), 5);
  EXPECT_TRUE(o->eraseProperty("apple"));
  o->setProperty("apple", Any(6));
  EXPECT_EQ(keysOf(*o), (std::vector<std::string>{"zebra", "middle", "beta", "apple"}));
}

// requirement
TEST(HostObject, ExtractGivesTheValueAndRemovesTheKey) {
  auto const o = Velorn::createObject();
  o->setProperty("a", Any(1));
  o->setProperty("b", Any(2));
  EXPECT_EQ(*o->extractProperty("a").get<int>(), 1);
  EXPECT_EQ(keysOf(*o), std::vector<std::string>{"b"});
  o->eraseAllProperties();
  EXPECT_TRUE(o->empty());
}

// requirement
TEST(HostObject, ClonesHoldTheSameValuesApart) {
  Ostil::Ptr<Velorn::Object> const shared = Velorn::createObject();
  shared->setProperty("a", Any(1));
  Ostil::MutablePtr<Velorn::Object> const own(shared);
  own->setProperty("a", Any(2));
  own->setProperty("b", Any(3));
  EXPECT_EQ(*shared->getProperty("a").get<int>(), 1);
  EXPECT_EQ(shared->size(), 1u);
  EXPECT_EQ(own->size(), 2u);
}

// requirement: capacity doubles, and starts at one
TEST(HostArray, GrowsByDoubling) {
  Ostil::Array<int> a;
  EXPECT_EQ(a.capacity(), 0u);
  std::vector<std::uint64_t> capacities;
  for (int n = 0; n < 9; ++n) {
    a.append(n);
    capacities.push_back(a.capacity());
  }
  EXPECT_EQ(capacities, (std::vector<std::uint64_t>{1, 2, 4, 4, 8, 8, 8, 8, 16}));
  EXPECT_EQ(a.back(), 8);
  a.removeLast();
  EXPECT_EQ(a.size(), 8u);
}

// requirement
TEST(HostArray, ResizeFillsWithZeroOrTheValue) {
  Ostil::Array<int> a{1, 2};
  a.resize(4);
  EXPECT_EQ(a, (Ostil::Array<int>{1, 2, 0, 0}));
  a.resize(6, 9);
  EXPECT_EQ(a[5], 9);
  Ostil::Array<int> b(3, 4);
  a.swap(b);
  EXPECT_EQ(a, (Ostil::Array<int>{4, 4, 4}));
  a.clear();
  EXPECT_TRUE(a.empty());
}

// requirement
TEST(HostJob, CancellationCanBeSet) {
  EXPECT_FALSE(Ostil::isJobCancelled());
  Ostil::setJobCancelled(true);
  EXPECT_TRUE(Ostil::isJobCancelled());
  Ostil::setJobCancelled(false);
  EXPECT_FALSE(Ostil::isJobCancelled());
}

// requirement
TEST(HostPaths, JoinAndSplit) {
  using namespace Velorn::FileUtils;
  EXPECT_EQ(filePath("a", "b"), "a/b");
  EXPECT_EQ(filePath("a/", "b"), "a/b");
  EXPECT_EQ(filePath("", "b"), "b");
  EXPECT_EQ(filename("a/b/c.txt"), "c.txt");
  EXPECT_EQ(filename("c.txt"), "c.txt");
  EXPECT_EQ(filename("a/"), "");
}

// requirement
TEST(HostBox, EmptyBoxesRunFromTheLargestToMinusTheLargest) {
  using namespace Velorn::Math;
  bbox<int3, int> ints;
  EXPECT_TRUE(ints.empty());
  EXPECT_EQ(ints.min, (int3{2147483647, 2147483647, 2147483647}));
  EXPECT_EQ(ints.max, (int3{-2147483647, -2147483647, -2147483647}));
  bbox<float3> floats;
  EXPECT_EQ(floats.min.x, 3.4028235e38f);
  EXPECT_EQ(floats.max.z, -3.4028235e38f);
  ints.grow({-5, 0, 5});
  EXPECT_FALSE(ints.empty());
  EXPECT_EQ(ints.min, ints.max);
  ints.grow({7, -1, 5});
  EXPECT_EQ(ints.min, (int3{-5, -1, 5}));
  EXPECT_EQ(ints.max, (int3{7, 0, 5}));
}
