// The volume object: components among properties, and their lookup and removal.
#include "GeometryVolume/core/Object.h"
#include "support/CountedComponents.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

using namespace Support;
using Ostil::Any;
using Ostil::Ptr;

namespace {

std::vector<std::string> namesOf(Ostil::Array<Ostil::String> const& list) {
  return {list.begin(), list.end()};
}

} // namespace

// requirement
TEST(Object, StartsEmptyWithAnObjectOfItsOwn) {
  VLN::Object const o;
  EXPECT_TRUE(o.empty());
  EXPECT_EQ(o.size(), 0u);
  EXPECT_EQ(o.componentsUseCount(), 1);
  EXPECT_TRUE(o.keys()->empty());
  EXPECT_TRUE(o.componentRange().empty());
}

// requirement
TEST(Object, WellKnownNames) {
  EXPECT_STREQ(VLN::Const::TileTreeChannelName, "tileTreeChannel");
  EXPECT_STREQ(VLN::Const::TileTreeContainerName, "tileTreeContainer");
  EXPECT_STREQ(VLN::Const::TileTreePointTopologyName, "tileTreePointTopo");
  EXPECT_STREQ(VLN::Const::TileTreeVoxelTopologyName, "tileTreeVoxelTopo");
  EXPECT_STREQ(VLN::Const::VoxelTopologyName, "voxelTopo");
}

// boundary
TEST(Object, ComponentWithoutANameIsNotStoredAndIsReleased) {
  VLN::Object o;
  int const before = NumberComponent::live();
  o.addComponent(Ostil::makePtr<NumberComponent>(""));
  o.putComponent(Ostil::makeMutable<NumberComponent>(""));
  EXPECT_EQ(o.size(), 0u);
  EXPECT_EQ(NumberComponent::live(), before);
  Ptr<VLN::Component> const kept = Ostil::makePtr<NumberComponent>("");
  o.addComponent(kept);
  EXPECT_EQ(kept.useCount(), 1);
}

// boundary
TEST(Object, SecondComponentUnderANameReplacesTheFirst) {
  VLN::Object o;
  o.addComponent(Ostil::makePtr<NumberComponent>("a", 1));
  o.putComponent(Ostil::makeMutable<NumberComponent>("a", 2));
  EXPECT_EQ(o.size(), 1u);
  EXPECT_EQ(o.component<NumberComponent>("a")->number(), 2);
}

// boundary
TEST(Object, ComponentOfAnotherClassIsNullForThatClassOnly) {
  VLN::Object o;
  o.addComponent(Ostil::makePtr<NumberComponent>("a", 1));
  EXPECT_FALSE(o.component<OtherComponent>("a"));
  EXPECT_FALSE(o.hasComponentFromName<OtherComponent>("a"));
  EXPECT_TRUE(o.hasComponentFromName("a"));
  EXPECT_TRUE(o.hasComponentFromName<NumberComponent>("a"));
  EXPECT_TRUE(o.component<VLN::Component>("a"));
}

// negative
TEST(Object, ComponentIsNullForAbsentAndPlainProperties) {
  VLN::Object o;
  o.setProperty("plain", Any(std::string("text")));
  o.setProperty("null", Any(Ptr<VLN::Component>()));
  o.setProperty("derived", Any(Ostil::makePtr<NumberComponent>("derived", 1)));
  for (char const* key : {"absent", "plain", "null", "derived"}) {
    SCOPED_TRACE(key);
    EXPECT_FALSE(o.component(key));
    EXPECT_FALSE(o.hasComponentFromName(key));
    EXPECT_FALSE(o.extractComponent(key));
    EXPECT_FALSE(o.extractComponent<NumberComponent>(key));
  }
  EXPECT_TRUE(o.hasProperty("plain"));
  EXPECT_TRUE(o.hasProperty("null"));
  EXPECT_TRUE(o.hasProperty("derived"));
  EXPECT_TRUE(o.componentRange().empty());
}

// requirement: by name only
TEST(Object, HasComponentLooksAtTheNameOnly) {
  VLN::Object o;
  o.addComponent(Ostil::makePtr<NumberComponent>("a", 1));
  EXPECT_TRUE(o.hasComponent(NumberComponent("a", 99)));
  EXPECT_FALSE(o.hasComponent(NumberComponent("b", 1)));
}

// requirement
TEST(Object, ComponentRangeFollowsTheOrderOfKeys) {
  VLN::Object o;
  o.addComponent(Ostil::makePtr<NumberComponent>("z"));
  o.setProperty("plain", Any(1));
  o.addComponent(Ostil::makePtr<NumberComponent>("a"));
  o.addComponent(Ostil::makePtr<OtherComponent>("m"));
  EXPECT_EQ(namesOf(o.componentRange()), (std::vector<std::string>{"z", "a", "m"}));
  EXPECT_EQ(namesOf(*o.keys()), (std::vector<std::string>{"z", "plain", "a", "m"}));
}

// requirement
TEST(Object, PropertiesForwardToTheHost) {
  VLN::Object o;
  o.setProperty("a", Any(1));
  EXPECT_TRUE(o.hasProperty("a"));
  EXPECT_EQ(*o.getProperty("a").get<int>(), 1);
  EXPECT_TRUE(o.getProperty("b").empty());
  EXPECT_EQ(*o.extractProperty("a").get<int>(), 1);
  EXPECT_TRUE(o.extractProperty("a").empty());
  EXPECT_FALSE(o.eraseProperty("a"));
  o.setProperty("a", Any(2));
  EXPECT_TRUE(o.eraseProperty("a"));
  EXPECT_TRUE(o.empty());
}

// boundary
TEST(Object, ClearRemovesComponentsAndPlainProperties) {
  for (bool byClear : {true, false}) {
    VLN::Object o;
    o.setProperty("plain", Any(1));
    o.addComponent(Ostil::makePtr<NumberComponent>("a"));
    if (byClear)
      o.clear();
    else
      o.eraseAllProperties();
    EXPECT_EQ(o.size(), 0u) << byClear;
    EXPECT_FALSE(o.hasProperty("plain"));
  }
}

// requirement: a sole owner's component is handed over as it is
TEST(Object, ExtractHandsASoleOwnersComponentOver) {
  VLN::Object o;
  o.putComponent(Ostil::makeMutable<NumberComponent>("a", 1));
  auto const* const stored = o.component("a").get();
  int const live = NumberComponent::live();
  auto const taken = o.extractComponent("a");
  EXPECT_EQ(taken.get(), stored);
  EXPECT_EQ(NumberComponent::live(), live);
  EXPECT_FALSE(o.hasProperty("a"));
  EXPECT_EQ(taken.useCount(), 1);
}

// requirement
TEST(Object, ExtractOfAHeldComponentGivesAClone) {
  VLN::Object o;
  auto held = Ostil::makePtr<ShiftedComponent>("a", 1);
  o.addComponent(held);
  auto const taken = o.extractComponent<ShiftedComponent>("a");
  ASSERT_TRUE(taken);
  EXPECT_NE(taken.get(), held.get());
  EXPECT_EQ(held.useCount(), 1);
  EXPECT_EQ(taken.useCount(), 1);
  taken->setNumber(2);
  EXPECT_EQ(held->number(), 1);
  EXPECT_EQ(taken->weight[3], 4u);
  EXPECT_FALSE(o.hasProperty("a"));
}

// negative
TEST(Object, ExtractOfAnotherClassLeavesTheComponent) {
  VLN::Object o;
  o.addComponent(Ostil::makePtr<NumberComponent>("a", 1));
  EXPECT_FALSE(o.extractComponent<OtherComponent>("a"));
  EXPECT_TRUE(o.hasComponentFromName("a"));
}

// boundary
TEST(Object, ExtractOfAPlainPropertyLeavesIt) {
  VLN::Object o;
  o.setProperty("plain", Any(1));
  EXPECT_FALSE(o.extractComponent("plain"));
  EXPECT_TRUE(o.hasProperty("plain"));
}

// requirement
TEST(Object, ExtractChangePutKeepsOthersHoldingTheOldState) {
  VLN::Object o;
  o.addComponent(Ostil::makePtr<NumberComponent>("a", 1));
  auto const before = o.component<NumberComponent>("a");
  auto own = o.extractComponent<NumberComponent>("a");
  own->setNumber(5);
  o.putComponent(std::move(own));
  EXPECT_EQ(before->number(), 1);
  EXPECT_EQ(o.component<NumberComponent>("a")->number(), 5);
}

// requirement: the removed component loses its target name; a plain property stays
TEST(Object, RemoveComponentTakesComponentsOnly) {
  VLN::Object o;
  auto const c = Ostil::makePtr<NumberComponent>("a", 1);
  c->setTargetName("target");
  o.addComponent(c);
  o.setProperty("plain", Any(1));
  o.removeComponent("a", nullptr);
  EXPECT_FALSE(o.hasProperty("a"));
  EXPECT_EQ(c->getTargetName(), "target") << "it was shared: the clone was cleared";
  o.removeComponent("plain");
  EXPECT_TRUE(o.hasProperty("plain"));
  o.removeComponent("absent");
  EXPECT_EQ(o.size(), 1u);
}
