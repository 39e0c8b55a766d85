// A container as a component of a volume: typed lookup, ownership, isolation.
#include "support/Print.h"
#include "support/RandomForest.h"
#include "support/Shapes.h"

#include "GeometryVolume/core/Object.h"

#include <gtest/gtest.h>

#include <type_traits>
#include <utility>

using namespace VLN::TileTree3D;
using Support::Access;

VLN_SHAPE_SUITE(ContainerInObject);

namespace {

template <class T> using OtherShape = std::conditional_t<T::kTW == 2, OddTraits, PowerOfTwoTraits>;

} // namespace

// requirement
TYPED_TEST(ContainerInObject, IsFoundUnderItsShapeAlone) {
  using T = TypeParam;
  VLN::Object volume;
  volume.putComponent(Ostil::makeMutable<Container<T>>());
  EXPECT_TRUE(volume.hasComponentFromName(VLN::Const::TileTreeContainerName));
  EXPECT_TRUE(volume.component<Container<T>>(VLN::Const::TileTreeContainerName));
  EXPECT_TRUE(volume.component<VLN::TileTree3D::Component>(VLN::Const::TileTreeContainerName));
  EXPECT_FALSE(volume.component<Container<OtherShape<T>>>(VLN::Const::TileTreeContainerName));
}

// requirement: a held container is cloned on extraction, its tiles stay shared until the first change
TYPED_TEST(ContainerInObject, ExtractedCopyIsPrivate) {
  using T = TypeParam;
  VLN::Object volume;
  volume.putComponent(Ostil::makeMutable<Container<T>>("tree", 0.5f));
  {
    auto own = volume.extractComponent<Container<T>>("tree");
    Access::addTile(*own, {0, 0, 0}, 4);
    volume.putComponent(std::move(own));
  }
  VLN::Object const other = volume;
  auto own = volume.extractComponent<Container<T>>("tree");
  auto const held = other.component<Container<T>>("tree");
  ASSERT_TRUE(own);
  ASSERT_NE(own.get(), held.get());
  EXPECT_TRUE(own->sharesTiles(*held));
  EXPECT_EQ(own->dataUseCount(), 1);
  Access::addTile(*own, {0, 0, 0}, 6);
  EXPECT_EQ(own->tileCount(-1), 3);
  EXPECT_EQ(held->tileCount(-1), 1);
}

// requirement
TYPED_TEST(ContainerInObject, DeepCopyOfTheVolumeIsolatesItsTree) {
  using T = TypeParam;
  VLN::Object volume;
  auto made = Ostil::makeMutable<Container<T>>("tree", 0.5f);
  made->setTargetName("target");
  made->setOwner("owner");
  Access::addTile(*made, {0, 0, 0}, 4);
  volume.putComponent(std::move(made));
  Ostil::Ptr<VLN::Object> copy;
  volume.copyTo(copy);
  auto own = copy->extractComponent<Container<T>>("tree");
  EXPECT_EQ(own->getTargetName(), "target");
  EXPECT_EQ(own->owner(), "owner");
  Access::addTile(*own, {0, 0, 0}, 0);
  EXPECT_EQ(volume.component<Container<T>>("tree")->tileCount(-1), 1);
}
