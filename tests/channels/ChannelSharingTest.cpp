// Copies share storage until written, and never see each other's writes.
#include "FakeTree.h"
#include "GeometryVolume/core/Object.h"
#include "ProbeChannel.h"

#include <functional>
#include <gtest/gtest.h>
#include <utility>

namespace {

using namespace VLN;
using namespace VLN::TileTree3D;
using namespace VLN::Test;

using C = ProbeChannel<PowerOfTwoTraits, float, 4, 0>;

FakeTree smallTree() {
  FakeTree tree;
  tree.set(0, 1, 64).set(3, 4, 64).set(28, 9, 64);
  return tree;
}
C filled(Flags const& flags = {}) {
  C channel(flags, 0.5f);
  channel.update(smallTree());
  float n = 0;
  for (int d : {0, 3, 28})
    for (std::int64_t i = 0; i < channel.tileCount(d); ++i)
      for (float& v : channel.tileData(i, d)) v = n++;
  return channel;
}
std::vector<float> contents(C const& channel) {
  std::vector<float> all;
  for (int d = 0; d < kChannelDepths; ++d)
    for (std::int64_t i = 0; i < channel.tileCount(d); ++i)
      for (float v : channel.tileData(i, d)) all.push_back(v);
  return all;
}

TEST(ChannelSharing, RequirementCopyHasItsOwnDataOnTheSameStorage) {
  C const a = filled();
  C b(a);
  EXPECT_FALSE(a.hasSameData(b));
  EXPECT_EQ(a.dataUseCount(), 1);
  EXPECT_EQ(b.dataPtr(), a.dataPtr());
  b.cloneData();
  EXPECT_NE(b.dataPtr(), a.dataPtr());
  EXPECT_EQ(contents(a), contents(b));
  b.tileData(0, 3)[5] = -1.0f;
  EXPECT_NE(contents(a), contents(b));
}

TEST(ChannelSharing, RequirementAssignmentSharesTheDataUntilOneIsCloned) {
  C a = filled();
  C b;
  b = a;
  EXPECT_TRUE(a.hasSameData(b));
  EXPECT_EQ(a.dataUseCount(), 2);
  std::uint64_t used = 0, allocated = 0, whole = 0, wholeAllocated = 0;
  a.memUse(used, allocated, false);
  a.memUse(whole, wholeAllocated, true);
  std::uint64_t base = 0, baseAllocated = 0, data = 0, dataAllocated = 0;
  a.VLN::Component::memUse(base, baseAllocated, false);
  a.getData()->memUse(data, dataAllocated);
  EXPECT_EQ(whole, base + sizeof(void*) * 2 + data);
  EXPECT_EQ(used, base + sizeof(void*) * 2 + data / 2);
  EXPECT_EQ(allocated, baseAllocated + sizeof(void*) * 2 + dataAllocated / 2);
  b.cloneData();
  EXPECT_FALSE(a.hasSameData(b));
  EXPECT_EQ(a.dataUseCount(), 1);
  EXPECT_EQ(contents(a), contents(b));
}

TEST(ChannelSharing, RequirementCloneWithoutSharersKeepsTheStorage) {
  C a = filled();
  void const* const before = a.dataPtr();
  a.cloneData();
  EXPECT_EQ(a.dataPtr(), before);
}

TEST(ChannelSharing, RequirementCopiedDataResetsItsFlags) {
  C a(Flags{true, false, true, 2, 20}, 3.0f);
  a.setDataElementInitializerType(kInitializeZero);
  C const b(a);
  EXPECT_FALSE(b.getData()->useStaticAllocation());
  EXPECT_TRUE(b.callElementConstructor());
  EXPECT_FALSE(b.getData()->rawCopy());
  EXPECT_FALSE(b.getData()->allocateEmptyTileData());
  EXPECT_EQ(b.blockCount(), 0u);
  EXPECT_EQ(b.defaultValue(), 3.0f);
  EXPECT_EQ(b.dataElementInitializerType(), kInitializeZero);
  EXPECT_EQ(b.minDepth(), 2);
  EXPECT_EQ(b.depth(), 20);
}

/// Every operation that writes separates by itself.
TEST(ChannelSharing, RequirementNoMutationIsSeenByACopy) {
  std::vector<std::pair<char const*, std::function<void(C&)>>> const mutations = {
      {"grow", [](C& c) { c.update(smallTree().set(5, 3, 64)); }},
      {"shrink", [](C& c) { c.update(smallTree().set(28, 2, 64)); }},
      {"removeTiles",
       [](C& c) {
         TileRemovalList list(kChannelDepths);
         list[28] = {{2, 8}};
         c.updateTilesRemoved(list, smallTree().set(28, 8, 64));
       }},
      {"removalListAlone",
       [](C& c) {
         TileRemovalList list(4);
         list[3] = {{0, 3}};
         c.updateTilesNoDispatch(&list);
       }},
      {"permute",
       [](C& c) {
         TilePermutation p(kChannelDepths);
         p[3] = {3, 1, 2, 0};
         c.permute(&p);
       }},
      {"moves",
       [](C& c) {
         std::vector<ElementToFrom> moves = {{1, 0, 7, 3}, {-1, 2, 0, 3}};
         c.update(moves, 3, false);
       }},
      {"growElements", [](C& c) { c.updateElementResizeNoDispatch(smallTree().set(3, 4, 70)); }},
      {"remove", [](C& c) { c.remove(3, 3); }},
      {"removeAll", [](C& c) { c.removeAll(); }},
      {"resizeDepth", [](C& c) { c.resize(28, 3, 64); }},
      {"compact", [](C& c) { c.compactStorage(); }},
      {"setDepth", [](C& c) { c.setDepth(10, smallTree()); }},
      {"setMinDepth", [](C& c) { c.setMinDepth(1, smallTree()); }},
      {"setDefault",
       [](C& c) {
         float const v = 8;
         c.setDefaultValue(&v);
       }},
      {"import",
       [](C& c) {
         auto values = Ostil::makePtr<Ostil::Array<float>>(c.size(), 6.0f);
         c.setChannelData(0, std::type_index(typeid(float)), values);
       }},
  };
  for (bool useStatic : {false, true}) {
    for (bool assigned : {false, true}) {
      for (auto const& [what, mutate] : mutations) {
        SCOPED_TRACE(testing::Message() << what << " static " << useStatic << " assigned " << assigned);
        auto original = std::make_unique<C>(filled());
        if (useStatic) *original = [] { return C(Flags{true}); }(), original->update(smallTree());
        auto const before = contents(*original);
        C copy(*original);
        if (assigned) copy = *original;
        mutate(copy);
        EXPECT_EQ(contents(*original), before);
        EXPECT_EQ(original->defaultValue(), useStatic ? 0.0f : 0.5f);
        auto const mutated = contents(copy);
        // And the other way round, after which the copy stands alone.
        mutate(*original);
        EXPECT_EQ(contents(copy), mutated);
        EXPECT_EQ(contents(*original), mutated);
        original.reset();
        EXPECT_EQ(contents(copy), mutated);
      }
    }
  }
}

TEST(ChannelSharing, RequirementStaticBlocksFollowTheStorage) {
  auto original = std::make_unique<C>(Flags{true}, 2.0f);
  original->update(smallTree());
  C copy(*original);
  ASSERT_TRUE(copy.isStatic({0, 3}));
  EXPECT_EQ(original->blockCount(), 1u);
  EXPECT_EQ(copy.blockCount(), 0u);
  auto const before = contents(copy);
  original.reset();
  EXPECT_EQ(contents(copy), before);
  // Now the copy holds the storage alone, tiles still lie in the handed-over block.
  copy.tileData(0, 3)[0] = 9.0f;
  TilePermutation p(kChannelDepths);
  p[3] = {1, 0, 2, 3};
  copy.permute(&p);
  EXPECT_EQ(std::as_const(copy).tileData(1, 3)[0], 9.0f);
  copy.update(smallTree().set(3, 6, 64));
  EXPECT_EQ(std::as_const(copy).tileData(1, 3)[0], 9.0f);
}

TEST(ChannelSharing, RequirementStaticOwnerThatSeparatesLeavesItsBlocks) {
  C original(Flags{true}, 2.0f);
  original.update(smallTree());
  C const copy(original);
  auto const before = contents(copy);
  original.cloneData();
  EXPECT_EQ(original.blockCount(), 1u);
  EXPECT_TRUE(original.isStatic({0, 3}));
  original.tileData(0, 3).set(7.0f);
  EXPECT_EQ(contents(copy), before);
}

TEST(ChannelSharing, RequirementExtractedCloneIsSeparatedWhole) {
  auto channel = Ostil::makePtr<C>(filled());
  VLN::Object object;
  object.addComponent(channel);
  auto const before = contents(*channel);
  auto extracted = object.extractComponent<C>("probe");
  ASSERT_TRUE(extracted);
  EXPECT_NE(extracted.get(), channel.get());
  EXPECT_NE(extracted->dataPtr(), channel->dataPtr());
  extracted->tileData(0, 28).set(-3.0f);
  EXPECT_EQ(contents(*channel), before);
}

TEST(ChannelSharing, RequirementCopyToIsDeepAndKeepsSettings) {
  C a(Flags{true, false, false, 1, 27}, 4.0f);
  a.setTargetName("topology");
  a.setOwner("container");
  FakeTree tree;
  tree.set(3, 2, 64);
  a.update(tree);
  for (std::int64_t i = 0; i < 2; ++i) a.tileData(i, 3).set(float(i));
  Ostil::Ptr<VLN::Component> target;
  a.copyTo(target);
  auto* const copy = dynamic_cast<Channel<PowerOfTwoTraits, float, 4, 0>*>(target.get());
  ASSERT_TRUE(copy);
  EXPECT_EQ(copy->name(), "probe");
  EXPECT_EQ(copy->getTargetName(), "topology");
  EXPECT_EQ(copy->owner(), "container");
  EXPECT_FALSE(copy->callElementConstructor());
  EXPECT_EQ(copy->minDepth(), 1);
  EXPECT_EQ(copy->depth(), 27);
  EXPECT_EQ(copy->defaultValue(), 4.0f);
  copy->tileData(1, 3)[0] = 100.0f;
  EXPECT_EQ(std::as_const(a).tileData(1, 3)[0], 1.0f);
  auto const same = target;
  static_cast<VLN::Component*>(copy)->copyTo(target);
  EXPECT_EQ(target, same);
}

} // namespace
