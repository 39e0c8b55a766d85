// Construction, access, settings and counts of channels.
#include "GeometryVolume/channels/Channel.h"
#include "FakeTree.h"
#include "GeometryVolume/core/ElementTypes.h"
#include "ProbeChannel.h"
#include "TestValues.h"

#include <gtest/gtest.h>
#include <sstream>
#include <utility>

namespace {

using namespace VLN;
using namespace VLN::TileTree3D;
using namespace VLN::Test;

using Plain = ProbeChannel<PowerOfTwoTraits, float, 4, 0>;
using Haloed = ProbeChannel<PowerOfTwoTraits, float, 4, 1>;
using Odd = ProbeChannel<OddTraits, float, 5, 0>;

template <class C> void checkChannel(int& checked) {
  using T = typename C::value_type;
  constexpr bool fixed = C::kLayout.fixedSize();
  T const seven = value<T>(7);
  C channel("c", &seven, kInitializeZero, false, true, 0, 28);
  EXPECT_EQ(channel.layout(), C::kLayout);
  EXPECT_EQ(channel.elementType(), typeid(T));
  EXPECT_TRUE(channel.hasElementType(std::type_index(typeid(T))));
  EXPECT_FALSE(channel.hasElementType(std::type_index(typeid(Stranger))));
  FakeTree tree;
  int const deepest = C::Traits::kMaxDepth;
  tree.set(2, 3, C::kLayout.tileDataWidth).set(deepest, 2, 5);
  channel.update(tree);
  EXPECT_EQ(channel.tileCount(-1), 5);
  int const size2 = fixed ? C::kSize : C::kLayout.tileDataWidth, sizeLast = fixed ? C::kSize : 5;
  EXPECT_EQ(channel.elementCount(2), 3 * size2);
  EXPECT_EQ(channel.elementCount(TreeIndex{1, deepest}), sizeLast);
  EXPECT_EQ(channel.size(), std::uint64_t(3 * size2 + 2 * sizeLast));
  EXPECT_EQ(std::as_const(channel)[ElementTreeIndex(1, deepest, 4)], seven);
  channel[ElementTreeIndex(1, deepest, 4)] = value<T>(9);
  EXPECT_EQ(channel.tileData(1, deepest)[4], value<T>(9));
  Ostil::Ptr<VLN::Component> copy;
  channel.copyTo(copy);
  auto const typed = Ostil::dynamicCast<C>(copy);
  ASSERT_TRUE(typed);
  EXPECT_EQ(std::as_const(*typed)[ElementTreeIndex(1, deepest, 4)], value<T>(9));
  ++checked;
}
TEST(Channel, RequirementEveryClassIsThere) {
  int types = 0, classes = 0;
#define VLN_CHECK_CLASS(traits, type, E, H) checkChannel<Channel<traits, type, E, H>>(classes);
#define VLN_CHECK_TYPE(type, name)                                                                           \
  ++types;                                                                                                   \
  VLN_FOR_EACH_CHANNEL_OF(type, VLN_CHECK_CLASS)
  VLN_FOR_EACH_ELEMENT_TYPE(VLN_CHECK_TYPE)
  EXPECT_EQ(classes, 8 * types);
}

TEST(Channel, BoundaryEmptyNameTakesTheStandardOne) {
  EXPECT_EQ(Plain(Flags{}, 0.0f, "").name(), "tileTreeChannel");
  Plain named;
  EXPECT_EQ(named.name(), "probe");
  named.setName("");
  EXPECT_EQ(Plain(named).name(), "tileTreeChannel");
}

TEST(Channel, RequirementConstants) {
  EXPECT_EQ((Channel<PowerOfTwoTraits, float, 4, 2>::kExtended), 0);
  EXPECT_EQ((Channel<PowerOfTwoTraits, float, 4, 2>::kHalo), 2);
  EXPECT_EQ((Channel<PowerOfTwoTraits, float, 5, 0>::kExtended), 1);
  EXPECT_EQ((Channel<OddTraits, float, 5, 1>::kExtended), 0);
  EXPECT_EQ((Channel<OddTraits, float, 6, 0>::kExtended), 1);
}

TEST(Channel, BoundaryNullDefaultIsZero) {
  Channel<PowerOfTwoTraits, float, 4, 0> channel("a", nullptr, kInitializeNone, false, true, 0, 28);
  EXPECT_EQ(channel.defaultValue(), 0.0f);
  float const three = 3;
  channel.setDefaultValue(&three);
  EXPECT_EQ(channel.defaultValue(), 3.0f);
  channel.setDefaultValue(nullptr);
  EXPECT_EQ(channel.defaultValue(), 0.0f);
}

TEST(Channel, RequirementChangingTheDefaultLeavesTilesAlone) {
  Plain channel(Flags{}, 4.0f);
  channel.update(FakeTree().set(1, 2, 8));
  float const five = 5;
  channel.setDefaultValue(&five);
  EXPECT_EQ(channel.tileData(0, 1)[7], 4.0f);
  channel.update(FakeTree().set(1, 3, 8));
  EXPECT_EQ(channel.tileData(2, 1)[7], 5.0f);
}

TEST(Channel, RequirementInitializerIsStoredAndSetterReturnsTheOldOne) {
  Plain channel;
  EXPECT_EQ(channel.dataElementInitializerType(), kInitializeDefaultValue);
  EXPECT_EQ(channel.setDataElementInitializerType(kInitializeNone), kInitializeDefaultValue);
  EXPECT_EQ(channel.dataElementInitializerType(), kInitializeNone);
  EXPECT_EQ(Plain::Data().initializer(), kInitializeDefaultValue);
}

TEST(Channel, RequirementRawCopyFlagNeverGoesBack) {
  Plain channel;
  EXPECT_FALSE(channel.getData()->rawCopy());
  channel.setCallElementConstructor(false);
  channel.setCallElementConstructor(true);
  EXPECT_TRUE(channel.callElementConstructor());
  EXPECT_TRUE(channel.getData()->rawCopy());
  EXPECT_TRUE(Plain(Flags{false, false}).getData()->rawCopy());
}

TEST(Channel, RequirementDefaultDataHasNoStorage) {
  Plain::Data const data;
  EXPECT_EQ(data.dataPtr(), nullptr);
  EXPECT_EQ(data.minDepth(), 0);
  EXPECT_EQ(data.depth(), 28);
  EXPECT_TRUE(data.callElementConstructor());
  EXPECT_FALSE(data.useStaticAllocation());
  EXPECT_FALSE(data.allocateEmptyTileData());
  EXPECT_EQ(data.elementCount(-1), 0);
}

TEST(Channel, RequirementMemUsageIsZero) {
  Plain channel;
  channel.update(FakeTree().set(1, 20, 64));
  EXPECT_EQ(channel.memUsage(), 0u);
}

TEST(Channel, RequirementAccessFormsAgree) {
  Haloed channel;
  channel.update(FakeTree().set(0, 1).set(2, 2).set(28, 3));
  Haloed const& read = channel;
  TreeIndex const tile{1, 28};
  channel.tileData(tile)(1, 2, 3) = 42.0f;
  std::int64_t const flat = channel.treeIndexToIndex(tile);
  EXPECT_EQ(flat, 1 + 2 + 1);
  EXPECT_EQ(channel.indexToTreeIndex(flat), tile);
  int const at = TileData<float, 4, 1>::index(1, 2, 3);
  EXPECT_EQ(read[ElementTreeIndex(tile, at)], 42.0f);
  EXPECT_EQ((read[VoxelTreeIndex(tile, {1, 2, 3})]), 42.0f);
  EXPECT_EQ(read[flat * Haloed::kSize + at], 42.0f);
  EXPECT_EQ(read.tileData(flat)(1, 2, 3), 42.0f);
  EXPECT_EQ(read.tileData(1, 28)(1, 2, 3), 42.0f);
  EXPECT_EQ(channel.getData()->tileData(flat)(1, 2, 3), 42.0f);
  channel[flat * Haloed::kSize + at] = 43.0f;
  EXPECT_EQ(channel[ElementTreeIndex(tile, at)], 43.0f);

  class Record : public Tile<PowerOfTwoTraits, 8> {
  public:
    Record() { init(-1, 0, 0, 0, 28, 1); }
  } const record;
  EXPECT_EQ((read(record, {1, 2, 3})), 43.0f);
  channel(record, {-1, 4, 0}) = 44.0f;
  EXPECT_EQ(read.tileData(tile)(-1, 4, 0), 44.0f);
}

TEST(Channel, RequirementIndexConversionWalksTheDepths) {
  Plain channel;
  FakeTree tree;
  tree.set(0, 2, 1).set(3, 4, 1).set(28, 5, 1);
  channel.update(tree);
  std::int64_t flat = 0;
  for (int d : {0, 3, 28})
    for (std::int64_t i = 0; i < channel.tileCount(d); ++i, ++flat) {
      EXPECT_EQ(channel.treeIndexToIndex({i, d}), flat);
      EXPECT_EQ(channel.indexToTreeIndex(flat), (TreeIndex{i, d}));
    }
}

TEST(Channel, BoundaryDepthsWithoutTilesAnswerZero) {
  Odd channel;
  FakeTree tree;
  tree.set(12, 3, 125);
  channel.update(tree);
  EXPECT_EQ(channel.tileCount(12), 3);
  for (int d : {-2, 13, 28, 29, 1000}) {
    EXPECT_EQ(channel.tileCount(d), 0) << d;
    EXPECT_EQ(channel.elementCount(d), 0) << d;
  }
  EXPECT_EQ(channel.elementCount(-1), 375);
}

/// Counts its calls.
class CountingTree final : public TileTree3D::Component {
public:
  std::uint64_t size() const override { return 0; }
  void update(VLN::Component const&) override {}
  std::int64_t elementCount(int) const override { return ++calls, 0; }
  int elementCount(TreeIndex const&) const override { return ++calls, 0; }
  std::int64_t tileCount(int) const override { return ++calls, 0; }
  mutable int calls = 0;
};

TEST(ChannelDepths, BoundarySettingTheSameDepthDoesNothing) {
  Plain channel(Flags{false, true, false, 2, 20});
  CountingTree const tree;
  channel.setDepth(20, tree);
  channel.setMinDepth(2, tree);
  EXPECT_EQ(tree.calls, 0);
}

TEST(ChannelDepths, RequirementNarrowingRemovesExactlyTheDepthsOutside) {
  FakeTree tree;
  for (int d = 0; d < kChannelDepths; ++d) tree.set(d, std::size_t(d) + 1, 8);
  Plain channel(Flags{}, 1.0f);
  channel.update(tree);
  channel.setDepth(20, tree);
  channel.setMinDepth(5, tree);
  std::int64_t total = 0;
  for (int d = 0; d < kChannelDepths; ++d) {
    bool const inside = d >= 5 && d <= 20;
    EXPECT_EQ(channel.tileCount(d), inside ? d + 1 : 0) << d;
    EXPECT_EQ(channel.elementCount(d), inside ? 8 * (d + 1) : 0) << d;
    total += channel.tileCount(d);
  }
  EXPECT_EQ(channel.tileCount(-1), total);
  EXPECT_EQ(channel.depth(), 20);
  EXPECT_EQ(channel.minDepth(), 5);
  channel.setDepth(22, tree);
  channel.setMinDepth(4, tree);
  EXPECT_EQ(channel.tileCount(22), 23);
  EXPECT_EQ(channel.tileCount(23), 0);
  EXPECT_EQ(channel.tileCount(4), 5);
  EXPECT_EQ(channel.tileCount(-1), total + 22 + 23 + 5);
}

TEST(ChannelDump, RequirementFreshChannelPrints29Zeros) {
  Plain channel;
  std::ostringstream os;
  channel.dump(os);
  std::string zeros = "0";
  for (int d = 1; d < 29; ++d) zeros += ", 0";
  EXPECT_NE(os.str().find("tileCount {28} =" + zeros + "\n"), std::string::npos) << os.str();
  EXPECT_NE(os.str().find("elementCount {28} =" + zeros + "\n"), std::string::npos);
  channel.update(FakeTree().set(1, 2, 3));
  std::ostringstream filled;
  channel.dump(filled);
  EXPECT_NE(filled.str().find("elementCount {28} =0, 6, 0"), std::string::npos) << filled.str();
}

} // namespace
