// Export to plain arrays and back.
#include "FakeTree.h"
#include "GeometryVolume/core/ElementTypes.h"
#include "ProbeChannel.h"
#include "TestValues.h"

#include <gtest/gtest.h>
#include <utility>

namespace {

using namespace VLN;
using namespace VLN::TileTree3D;
using namespace VLN::Test;

template <class T> using C = ProbeChannel<OddTraits, T, 5, 0>;

FakeTree tree() {
  FakeTree t;
  t.elements[0] = {3};
  t.elements[2] = {5, 0, 2};
  t.elements[12] = {1, 4};
  return t;
}
template <class T> C<T> numbered(Flags const& flags = {}) {
  C<T> channel(flags);
  channel.update(tree());
  std::uint64_t n = 1;
  for (int d : {0, 2, 12})
    for (std::int64_t i = 0; i < channel.tileCount(d); ++i)
      for (T& v : channel.tileData(i, d)) v = value<T>(n++);
  return channel;
}
template <class T> Ostil::Any type() { return std::type_index(typeid(T)); }

template <class T> void checkRoundTrip() {
  SCOPED_TRACE(typeid(T).name());
  C<T> channel = numbered<T>();
  auto const flat = Ostil::staticCast<Ostil::Array<T>>(channel.channelData(0, type<T>()));
  ASSERT_EQ(flat->size(), channel.size());
  for (std::uint64_t n = 0; n < flat->size(); ++n) EXPECT_EQ((*flat)[n], value<T>(n + 1));
  auto const nested = Ostil::staticCast<NestedArrays<T>>(channel.channelData(3, type<T>()));
  ASSERT_EQ(nested->size(), 29u);
  EXPECT_EQ((*nested)[2]->size(), 3u);
  EXPECT_EQ((*(*nested)[2])[1]->size(), 0u);
  EXPECT_EQ((*(*(*nested)[2])[2])[1], value<T>(10));
  for (unsigned kind : {0u, 3u}) {
    C<T> other;
    other.update(tree());
    C<T> const copy(other);
    other.setChannelData(kind, type<T>(), channel.channelData(kind, type<T>()));
    EXPECT_EQ(*Ostil::staticCast<Ostil::Array<T>>(other.channelData(0, type<T>())), *flat);
    // The storage was shared: the copy keeps its zeros.
    EXPECT_EQ(copy.tileData(0, 0)[0], T{});
    other.setChannelData(kind, type<T>(), channel.channelData(kind, type<T>()));
    EXPECT_EQ(*Ostil::staticCast<Ostil::Array<T>>(other.channelData(0, type<T>())), *flat);
  }
}

TEST(ChannelArrays, RequirementRoundTripForEveryType) {
#define VLN_CHECK(type, name) checkRoundTrip<type>();
  VLN_FOR_EACH_ELEMENT_TYPE(VLN_CHECK)
}

TEST(ChannelArrays, NegativeOtherKindsAndTypesGiveAnEmptyArray) {
  C<float> channel = numbered<float>();
  for (unsigned kind : {1u, 2u, 4u, 99u}) {
    auto const array = Ostil::staticCast<Ostil::Array<float>>(channel.channelData(kind, type<float>()));
    ASSERT_TRUE(array);
    EXPECT_TRUE(array->empty());
  }
  EXPECT_TRUE(Ostil::staticCast<Ostil::Array<float>>(channel.channelData(0, type<double>()))->empty());
  EXPECT_TRUE(Ostil::staticCast<Ostil::Array<float>>(channel.channelData(0, Ostil::Any()))->empty());
}

TEST(ChannelArrays, NegativeWrongSizesChangeNothing) {
  C<float> channel = numbered<float>();
  auto const before = *Ostil::staticCast<Ostil::Array<float>>(channel.channelData(0, type<float>()));
  auto const unchanged = [&] {
    return *Ostil::staticCast<Ostil::Array<float>>(channel.channelData(0, type<float>())) == before;
  };
  auto flat = Ostil::makePtr<Ostil::Array<float>>(before);
  flat->removeLast();
  for (float& v : *flat) v = -1;
  channel.setChannelData(0, type<float>(), flat);
  EXPECT_TRUE(unchanged());
  channel.setChannelData(0, type<float>(), nullptr);
  EXPECT_TRUE(unchanged());
  channel.setChannelData(1, type<float>(), flat);
  EXPECT_TRUE(unchanged());
  flat->append(-1);
  channel.setChannelData(0, type<int>(), flat);
  EXPECT_TRUE(unchanged());

  auto const nested = [&] {
    return Ostil::staticCast<NestedArrays<float>>(channel.channelData(3, type<float>()));
  };
  auto shortDepths = nested();
  (*(*(*shortDepths)[0])[0])[0] = -1;
  shortDepths->removeLast();
  channel.setChannelData(3, type<float>(), shortDepths);
  EXPECT_TRUE(unchanged());
  auto shortTiles = nested();
  (*(*(*shortTiles)[0])[0])[0] = -1;
  (*shortTiles)[12]->removeLast();
  channel.setChannelData(3, type<float>(), shortTiles);
  EXPECT_TRUE(unchanged());
  auto shortTile = nested();
  (*(*(*shortTile)[0])[0])[0] = -1;
  (*(*shortTile)[12])[1]->removeLast();
  channel.setChannelData(3, type<float>(), shortTile);
  EXPECT_TRUE(unchanged());
  auto lostDepth = nested();
  (*lostDepth)[2] = nullptr;
  channel.setChannelData(3, type<float>(), lostDepth);
  EXPECT_TRUE(unchanged());
}

TEST(ChannelArrays, RequirementDepthsOutsideTheRangeAreNull) {
  C<float> channel(Flags{false, true, false, 2, 12});
  channel.update(tree());
  auto const nested = Ostil::staticCast<NestedArrays<float>>(channel.channelData(3, type<float>()));
  EXPECT_FALSE((*nested)[0]);
  EXPECT_FALSE((*nested)[13]);
  EXPECT_TRUE((*nested)[2]);
  EXPECT_TRUE((*nested)[5]);
  EXPECT_EQ(Ostil::staticCast<Ostil::Array<float>>(channel.channelData(0, type<float>()))->size(), 12u);
}

TEST(ChannelArrays, RequirementImportIntoSharedStaticStorage) {
  C<float> a = numbered<float>(Flags{true});
  C<float> const b(a);
  auto values = Ostil::makePtr<Ostil::Array<float>>(a.size(), 3.0f);
  a.setChannelData(0, type<float>(), values);
  EXPECT_TRUE(a.isStatic({0, 12}));
  EXPECT_EQ(std::as_const(a).tileData(1, 12)[3], 3.0f);
  EXPECT_EQ(b.tileData(1, 12)[3], 15.0f);
  a.removeAll();
  EXPECT_EQ(b.tileData(1, 12)[3], 15.0f);
}

TEST(ChannelArrays, BoundaryChannelWithoutTiles) {
  C<float> channel;
  EXPECT_TRUE(Ostil::staticCast<Ostil::Array<float>>(channel.channelData(0, type<float>()))->empty());
  channel.setChannelData(0, type<float>(), Ostil::makePtr<Ostil::Array<float>>());
  EXPECT_EQ(channel.size(), 0u);
}

} // namespace
