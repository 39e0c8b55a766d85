// Changes of a tree reach all channels of an object that belong to it, and only those.
#include "GeometryVolume/channels/UpdateDispatch.h"
#include "FakeTree.h"
#include "ProbeChannel.h"

#include <atomic>
#include <gtest/gtest.h>
#include <map>
#include <stdexcept>
#include <thread>
#include <utility>

namespace {

using namespace VLN;
using namespace VLN::TileTree3D;
using namespace VLN::Test;

using C = Channel<PowerOfTwoTraits, float, 4, 0>;

Ostil::MutablePtr<C> channel(Ostil::String const& name, Ostil::String const& target,
                             Ostil::String const& owner = "") {
  auto c = Ostil::makeMutable<C>(name, nullptr, kInitializeDefaultValue, false, true, 0, 28);
  c->setTargetName(target);
  c->setOwner(owner);
  return c;
}
std::int64_t tiles(VLN::Object const& object, Ostil::String const& name) {
  return object.component<C>(name)->tileCount(-1);
}

TEST(UpdateDispatch, RequirementReachesChannelsByTargetOrOwner) {
  VLN::Object object;
  object.setProperty("author", Ostil::Any(Ostil::String("me")));
  object.putComponent(channel("byTarget", "tree"));
  object.putComponent(channel("other", "elsewhere"));
  object.putComponent(channel("byOwner", "topology", "tree"));
  auto const otherTree = Ostil::makePtr<FakeTree>("notAChannel");
  otherTree->setTargetName("tree");
  object.addComponent(otherTree);
  auto const keys = *object.keys();
  updateTilesAdded(FakeTree("tree").set(2, 4, 3), object);
  EXPECT_EQ(tiles(object, "byTarget"), 4);
  EXPECT_EQ(tiles(object, "byOwner"), 4);
  EXPECT_EQ(tiles(object, "other"), 0);
  EXPECT_EQ(object.component("notAChannel").get(), otherTree.get());
  EXPECT_EQ(*object.keys(), keys);
}

TEST(UpdateDispatch, BoundaryObjectsWithoutChannels) {
  VLN::Object object;
  updateTilesAdded(FakeTree("tree").set(2, 4, 3), object);
  EXPECT_TRUE(object.empty());
}

TEST(UpdateDispatch, RequirementAllFourChangesArrive) {
  VLN::Object object;
  for (auto const* name : {"a", "b", "c"}) object.putComponent(channel(name, "tree"));
  FakeTree tree("tree");
  tree.set(2, 4, 3);
  updateTilesAdded(tree, object);
  for (auto const* name : {"a", "b", "c"}) {
    auto c = object.extractComponent<C>(name);
    for (std::int64_t i = 0; i < 4; ++i) c->tileData(i, 2).set(float(i));
    object.putComponent(std::move(c));
  }
  TilePermutation p(kChannelDepths);
  p[2] = {3, 2, 1, 0};
  updateTilesPermuted(p, tree, object);
  EXPECT_EQ(std::as_const(*object.component<C>("b")).tileData(0, 2)[0], 3.0f);
  TileRemovalList removed(kChannelDepths);
  removed[2] = {{0, 3}};
  updateTilesRemoved(removed, tree.set(2, 3, 3), object);
  EXPECT_EQ(std::as_const(*object.component<C>("c")).tileData(0, 2)[0], 0.0f);
  EXPECT_EQ(tiles(object, "a"), 3);

  ElementMoves moves(kChannelDepths);
  moves[2] = {{2, 0, 0, 2}};
  ElementOrder order;
  DestinationTiles to;
  ArrivalMap arrivals;
  object.component<C>("a")->computePermutation(moves, order, to, arrivals, false);
  updateElements(moves, order, to, arrivals, tree, object);
  for (auto const* name : {"a", "b", "c"}) {
    C const& c = *object.component<C>(name);
    EXPECT_EQ(c.elementCount(TreeIndex{0, 2}), 2) << name;
    EXPECT_EQ(c.elementCount(TreeIndex{2, 2}), 4) << name;
    EXPECT_EQ(c.tileData(2, 2)[3], 0.0f) << name;
  }
}

TEST(UpdateDispatch, RequirementOtherHoldersKeepWhatTheyHad) {
  VLN::Object object;
  object.putComponent(channel("a", "tree"));
  updateTilesAdded(FakeTree("tree").set(2, 4, 3), object);
  VLN::Object const copy = object;
  auto const held = object.component<C>("a");
  updateTilesAdded(FakeTree("tree").set(2, 9, 3), object);
  EXPECT_EQ(tiles(object, "a"), 9);
  EXPECT_EQ(tiles(copy, "a"), 4);
  EXPECT_EQ(held->tileCount(2), 4);
  EXPECT_EQ(std::as_const(*held).tileData(3, 2)[2], 0.0f);
}

/// Where a channel's elements lie, to tell which of them were copied.
class Bytes {
public:
  explicit Bytes(VLN::Object const& object) {
    for (auto const& tiles : *object.component<Probe>("a")->dataPtr())
      for (auto const& tile : tiles) m_places.emplace(tile.data(), tile.size() * sizeof(float));
  }
  /// Bytes of these that do not lie where they did in `before`.
  std::size_t copiedSince(Bytes const& before) const {
    std::size_t sum = 0;
    for (auto const& [place, size] : m_places) sum += before.m_places.contains(place) ? 0 : size;
    return sum;
  }

  using Probe = ProbeChannel<PowerOfTwoTraits, float, 4, 0>;

private:
  std::map<float const*, std::size_t> m_places;
};

class DispatchInPlace : public ::testing::TestWithParam<bool> {
protected:
  using Probe = Bytes::Probe;
  DispatchInPlace() {
    auto made =
        Ostil::makeMutable<Probe>(Flags{.useStatic = GetParam(), .construct = false, .depth = 20}, 7.0f, "a");
    m_channel = made.get();
    m_channel->setTargetName("tree");
    m_channel->setDataElementInitializerType(kInitializeNone);
    m_object.putComponent(std::move(made));
    m_tree.set(2, 100, 64);
    updateTilesAdded(m_tree, m_object);
  }
  /// That the object still holds the channel that was put into it, as it was made.
  void expectTheSameChannel(std::size_t blocks) {
    ASSERT_EQ(m_object.component("a").get(), m_channel);
    EXPECT_EQ(m_channel->blockCount(), GetParam() ? blocks : 0u);
    EXPECT_EQ(m_channel->isStatic({0, 2}), GetParam());
    EXPECT_FALSE(m_channel->callElementConstructor());
    EXPECT_EQ(m_channel->defaultValue(), 7.0f);
    EXPECT_EQ(m_channel->dataElementInitializerType(), kInitializeNone);
    EXPECT_EQ(m_channel->depth(), 20);
    EXPECT_EQ(m_channel->dataUseCount(), 1);
  }

  VLN::Object m_object;
  FakeTree m_tree{"tree"};
  Probe* m_channel;
  static constexpr std::size_t kTile = 64 * sizeof(float);
};

TEST_P(DispatchInPlace, RegressionAddedTilesLeaveTheOthersWhereTheyAre) {
  void const* const storage = m_channel->dataPtr();
  Bytes const before(m_object);
  updateTilesAdded(m_tree.set(2, 103, 64), m_object);
  expectTheSameChannel(2);
  EXPECT_EQ(m_channel->dataPtr(), storage);
  EXPECT_EQ(Bytes(m_object).copiedSince(before), 3 * kTile) << "the new ones alone are written";
}

TEST_P(DispatchInPlace, RegressionRemovedTilesLeaveTheOthersWhereTheyAre) {
  void const* const storage = m_channel->dataPtr();
  Bytes const before(m_object);
  TileRemovalList removed(kChannelDepths);
  removed[2] = {{4, 99}};
  updateTilesRemoved(removed, m_tree.set(2, 99, 64), m_object);
  expectTheSameChannel(1);
  EXPECT_EQ(m_channel->dataPtr(), storage);
  EXPECT_EQ(Bytes(m_object).copiedSince(before), 0u);
}

TEST_P(DispatchInPlace, RegressionPermutedTilesAreHandedOn) {
  Bytes const before(m_object);
  TilePermutation p(kChannelDepths);
  for (std::int64_t i = 99; i >= 0; --i) p[2].push_back(i);
  updateTilesPermuted(p, m_tree, m_object);
  expectTheSameChannel(1);
  // A block is laid out anew; tiles of their own change hands.
  EXPECT_EQ(Bytes(m_object).copiedSince(before), GetParam() ? 100 * kTile : 0u);
}

TEST_P(DispatchInPlace, RegressionElementMovesTouchTheirTilesAlone) {
  void const* const storage = m_channel->dataPtr();
  Bytes const before(m_object);
  ElementMoves moves(kChannelDepths);
  moves[2] = {{8, 5, 0, 2}};
  ElementOrder order;
  DestinationTiles to;
  ArrivalMap arrivals;
  m_channel->computePermutation(moves, order, to, arrivals, true);
  updateElements(moves, order, to, arrivals, m_tree, m_object);
  expectTheSameChannel(1);
  EXPECT_EQ(m_channel->dataPtr(), storage);
  EXPECT_EQ(m_channel->elementCount(TreeIndex{8, 2}), 65);
  EXPECT_EQ(Bytes(m_object).copiedSince(before), 65 * sizeof(float));
}

TEST_P(DispatchInPlace, RegressionEmptyTilesStayEmpty) {
  m_channel->enableAllocateEmptyTileData();
  updateTilesAdded(m_tree.set(2, 103, 64), m_object);
  expectTheSameChannel(1);
  EXPECT_TRUE(m_channel->getData()->allocateEmptyTileData());
  EXPECT_EQ(m_channel->elementCount(TreeIndex{102, 2}), 0);
}

INSTANTIATE_TEST_SUITE_P(Storage, DispatchInPlace, ::testing::Bool(),
                         [](auto const& tested) { return tested.param ? "Static" : "Own"; });

/// Remembers the thread that asked for its counts.
class Asked final : public TileTree3D::Component {
public:
  using TileTree3D::Component::Component;
  std::uint64_t size() const override { return 0; }
  void update(VLN::Component const&) override {}
  std::int64_t elementCount(int) const override { return 0; }
  int elementCount(TreeIndex const&) const override { return 0; }
  std::int64_t tileCount(int) const override {
    if (fails) throw std::runtime_error("no counts");
    thread = std::this_thread::get_id();
    return 0;
  }
  mutable std::thread::id thread;
  bool fails = false;
};

TEST(UpdateDispatch, RequirementASingleChannelIsCalledOnTheCallingThread) {
  VLN::Object object;
  object.putComponent(channel("a", "tree"));
  Asked const tree("tree");
  updateTilesAdded(tree, object);
  EXPECT_EQ(tree.thread, std::this_thread::get_id());
}

TEST(UpdateDispatch, NegativeChannelsComeBackWhenAnUpdateThrows) {
  VLN::Object object;
  object.putComponent(channel("a", "tree"));
  object.putComponent(channel("b", "tree"));
  Asked tree("tree");
  tree.fails = true;
  EXPECT_THROW(updateTilesAdded(tree, object), std::runtime_error);
  EXPECT_TRUE(object.component<C>("a"));
  EXPECT_TRUE(object.component<C>("b"));
}

} // namespace
