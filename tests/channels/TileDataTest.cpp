// Constants, access, setters and ownership of tile data, over every layout and enabled element type.
#include "GeometryVolume/channels/TileData.h"
#include "GeometryVolume/core/ElementTypes.h"
#include "TestValues.h"

#include <gtest/gtest.h>
#include <type_traits>
#include <vector>

namespace {

using namespace VLN;
using namespace VLN::TileTree3D;
using VLN::Test::value;

template <class TypeV, int EV, int HV> struct Layout {
  using T = TypeV;
  static constexpr int E = EV, H = HV;
};

template <class L> class TileDataOf : public ::testing::Test {};

// Every layout, and element types of other sizes on a few.
using Layouts =
    ::testing::Types<Layout<unsigned char, 2, 0>, Layout<float, 4, 0>, Layout<float, 4, 1>,
                     Layout<float, 4, 2>, Layout<float, 5, 0>, Layout<float, 5, 1>, Layout<float, 5, 2>,
                     Layout<float, 6, 0>, Layout<float, 6, 1>, Layout<float, 8, 0>, Layout<float, 8, 1>,
                     Layout<float, 9, 0>, Layout<unsigned char, 4, 2>, Layout<Velorn::Math::float3, 5, 1>>;
TYPED_TEST_SUITE(TileDataOf, Layouts);

#define VLN_USING                                                                                            \
  using T [[maybe_unused]] = typename TypeParam::T;                                                          \
  [[maybe_unused]] constexpr int E = TypeParam::E, H = TypeParam::H;                                         \
  using TD = TileData<T, E, H>;                                                                              \
  using CTD [[maybe_unused]] = ConstTileData<T, E, H>

/// A tile whose every element differs from its flat neighbours.
template <class TD> TD numbered() {
  TD tile(TD::kSize);
  for (int n = 0; n < TD::kSize; ++n) tile[n] = value<typename TD::value_type>(n % 199 + 1);
  return tile;
}
template <class TD, class Inside> void expectChanged(TD const& tile, TD const& before, Inside const& inside) {
  using T = typename TD::value_type;
  for (int k = TD::kMinCoord; k <= TD::kMaxCoord; ++k)
    for (int j = TD::kMinCoord; j <= TD::kMaxCoord; ++j)
      for (int i = TD::kMinCoord; i <= TD::kMaxCoord; ++i)
        ASSERT_EQ(tile(i, j, k), inside(i, j, k) ? value<T>(0) : before(i, j, k))
            << i << ' ' << j << ' ' << k;
}
template <int E> bool inCore(int i, int j, int k) {
  return i >= 0 && i < E && j >= 0 && j < E && k >= 0 && k < E;
}

TYPED_TEST(TileDataOf, RequirementConstants) {
  VLN_USING;
  constexpr int W = E + 2 * H;
  EXPECT_EQ(TD::kCore, E);
  EXPECT_EQ(TD::kCoreSize, E * E * E);
  EXPECT_EQ(TD::kHalo, H);
  EXPECT_EQ(TD::kWidth, W);
  EXPECT_EQ(TD::kSize, W * W * W);
  EXPECT_EQ(TD::kStrideI, 1);
  EXPECT_EQ(TD::kStrideJ, W);
  EXPECT_EQ(TD::kStrideK, W * W);
  EXPECT_EQ(TD::kIncI, 1);
  EXPECT_EQ(TD::kIncJ, 2 * H);
  EXPECT_EQ(TD::kIncK, W * 2 * H);
  EXPECT_EQ(TD::kMinCoord, -H);
  EXPECT_EQ(TD::kMaxCoord, E + H - 1);
  EXPECT_EQ(TD::kNBI, 1);
  EXPECT_EQ(TD::kNBJ, W);
  EXPECT_EQ(TD::kNBK, W * W);
  EXPECT_EQ(TD::kNBIJ, 1 + W);
  EXPECT_EQ(TD::kNBIK, 1 + W * W);
  EXPECT_EQ(TD::kNBJK, W + W * W);
  EXPECT_EQ(TD::kNBIJK, 1 + W + W * W);
}

TYPED_TEST(TileDataOf, RequirementIndexCoversTheCubeInOrder) {
  VLN_USING;
  constexpr int low = TD::kMinCoord, high = TD::kMaxCoord;
  EXPECT_EQ(TD::index(low, low, low), 0);
  EXPECT_EQ(TD::index(high, high, high), TD::kSize - 1);
  EXPECT_EQ(TD::index(0, 0, 0), H * (1 + TD::kWidth + TD::kWidth * TD::kWidth));
  int flat = 0;
  for (int k = low; k <= high; ++k)
    for (int j = low; j <= high; ++j)
      for (int i = low; i <= high; ++i, ++flat) {
        ASSERT_EQ(TD::index(i, j, k), flat);
        ASSERT_EQ(TD::index(int3{i, j, k}), flat);
      }
  auto tile = numbered<TD>();
  CTD const& read = tile;
  EXPECT_EQ(&read(high, low, high), &read[TD::index(high, low, high)]);
  EXPECT_EQ(&read(int3{low, high, 0}), (&tile[int3{low, high, 0}]));
  EXPECT_EQ(&read(3), &tile(3));
}

TEST(TileData, RequirementCoreOrigins) {
  EXPECT_EQ((TileData<float, 4, 1>::index(0, 0, 0)), 43);
  EXPECT_EQ((TileData<float, 4, 2>::index(0, 0, 0)), 146);
  EXPECT_EQ((TileData<float, 5, 1>::index(0, 0, 0)), 57);
  EXPECT_EQ((TileData<float, 5, 2>::index(0, 0, 0)), 182);
  EXPECT_EQ((TileData<float, 6, 1>::index(0, 0, 0)), 73);
  EXPECT_EQ((TileData<float, 8, 1>::index(0, 0, 0)), 111);
  EXPECT_EQ((TileData<float, 9, 0>::index(0, 0, 0)), 0);
}

TYPED_TEST(TileDataOf, RequirementWalkByIncrementsVisitsTheCore) {
  VLN_USING;
  int flat = TD::index(0, 0, 0);
  for (int k = 0; k < E; ++k, flat += TD::kIncK)
    for (int j = 0; j < E; ++j, flat += TD::kIncJ)
      for (int i = 0; i < E; ++i, flat += TD::kIncI) ASSERT_EQ(flat, TD::index(i, j, k));
}

TYPED_TEST(TileDataOf, RequirementSetCoreAndSetHaloPartTheTile) {
  VLN_USING;
  auto const before = numbered<TD>();
  TD core = before, halo = before;
  core.setCore(value<T>(0));
  expectChanged(core, before, inCore<E>);
  halo.setHalo(value<T>(0));
  expectChanged(halo, before, [](int i, int j, int k) { return !inCore<E>(i, j, k); });
  TD zero(TD::kSize, value<T>(0)), copied = before;
  copied.setHalo(static_cast<CTD const&>(zero));
  expectChanged(copied, before, [](int i, int j, int k) { return !inCore<E>(i, j, k); });
}

TYPED_TEST(TileDataOf, RequirementHaloEdgesHaveTwoCoordinatesAtAnEnd) {
  VLN_USING;
  auto const before = numbered<TD>();
  TD tile = before;
  tile.setHaloEdges(value<T>(0));
  auto const atEnd = [](int c) { return c == TD::kMinCoord || c == TD::kMaxCoord; };
  expectChanged(tile, before,
                [&](int i, int j, int k) { return H > 0 && atEnd(i) + atEnd(j) + atEnd(k) >= 2; });
  if (H > 0) { EXPECT_EQ(std::count(tile.begin(), tile.end(), value<T>(0)), 8 + 12 * (TD::kWidth - 2)); }
}

TYPED_TEST(TileDataOf, RequirementRangesAreHalfOpen) {
  VLN_USING;
  constexpr int low = TD::kMinCoord, high = TD::kMaxCoord;
  auto const before = numbered<TD>();
  auto const check = [&](auto const& write, auto const& inside) {
    TD tile = before;
    write(tile);
    expectChanged(tile, before, inside);
  };
  T const v = value<T>(0);
  check([&](TD& t) { t.setRange(low, high, 0, 2, 0, high + 1, v); },
        [](int i, int j, int k) { return i < high && j >= 0 && j < 2 && k >= 0; });
  check([&](TD& t) { t.setIJRange(0, 2, low, 1, 1, v); },
        [](int i, int j, int k) { return i >= 0 && i < 2 && j < 1 && k == 1; });
  check([&](TD& t) { t.setIKRange(0, 2, 1, low, 1, v); },
        [](int i, int j, int k) { return i >= 0 && i < 2 && j == 1 && k < 1; });
  check([&](TD& t) { t.setJKRange(high, 0, 2, low, 1, v); },
        [](int i, int j, int k) { return i == high && j >= 0 && j < 2 && k < 1; });
  check([&](TD& t) { t.setIRange(low, 1, 0, 1, v); },
        [](int i, int j, int k) { return i < 1 && j == 0 && k == 1; });
  check([&](TD& t) { t.setJRange(low, low, high + 1, 1, v); },
        [](int i, int, int k) { return i == low && k == 1; });
  check([&](TD& t) { t.setKRange(1, high, 0, 1, v); },
        [](int i, int j, int k) { return i == 1 && j == high && k == 0; });
  auto const nothing = [](int, int, int) { return false; };
  check([&](TD& t) { t.setRange(1, 1, 0, 2, 0, 2, v); }, nothing);
  check([&](TD& t) { t.setRange(1, 0, 0, 2, 0, 2, v); }, nothing);
  check([&](TD& t) { t.setIRange(1, 0, 0, 0, v); }, nothing);
  check([&](TD& t) { t.setJRange(0, 1, 1, 0, v); }, nothing);
  check([&](TD& t) { t.setKRange(0, 0, 1, 0, v); }, nothing);
}

TYPED_TEST(TileDataOf, BoundaryValueInsideTheTileIsReadOnce) {
  VLN_USING;
  auto tile = numbered<TD>();
  T const last = tile[TD::kSize - 1];
  tile.set(tile[TD::kSize - 1]);
  EXPECT_EQ(std::count(tile.begin(), tile.end(), last), TD::kSize);
  auto ranged = numbered<TD>();
  T const second = ranged(1, 0, 0);
  ranged.setRange(0, 2, 0, 2, 0, 2, ranged(1, 0, 0));
  EXPECT_EQ(ranged(0, 0, 0), second);
  EXPECT_EQ(ranged(1, 1, 1), second);
}

TYPED_TEST(TileDataOf, RequirementCopyRangeStopsAtTheShorterEnd) {
  VLN_USING;
  auto const before = numbered<TD>();
  TD tile = before;
  tile.copyRange(0, 1, 0, E, 0, 1, E - 1, E, 0, E, E - 1, 99);
  for (int j = 0; j < E; ++j) EXPECT_EQ(tile(E - 1, j, E - 1), before(0, j, 0));
  // An overlapping copy along i repeats the first element.
  TD overlap = before;
  overlap.copyRange(0, E - 1, 0, 1, 0, 1, 1, E, 0, 1, 0, 1);
  for (int i = 0; i < E; ++i) EXPECT_EQ(overlap(i, 0, 0), before(0, 0, 0));
  TD none = before;
  none.copyRange(2, 0, 0, 1, 0, 1, 0, 2, 0, 1, 0, 1);
  EXPECT_TRUE(std::equal(none.begin(), none.end(), before.begin()));
}

/// Guard elements round a static tile: no setter may write outside its tile.
TYPED_TEST(TileDataOf, RequirementSettersStayInsideTheTile) {
  VLN_USING;
  constexpr int kGuard = 64;
  std::vector<T> block(TD::kSize + 2 * kGuard, value<T>(77));
  TileVector<T> vector(TD::kSize, value<T>(1), TileDataAllocator<T>(block.data() + kGuard, TD::kSize, true));
  ASSERT_EQ(vector.data(), block.data() + kGuard);
  TD tile(&vector);
  auto const other = numbered<TD>();
  constexpr int low = TD::kMinCoord, end = TD::kMaxCoord + 1;
  tile.set(value<T>(2));
  tile.set(static_cast<CTD const&>(other));
  tile.setCore(value<T>(3));
  tile.setHalo(value<T>(4));
  tile.setHalo(static_cast<CTD const&>(other));
  tile.setHaloEdges(value<T>(5));
  tile.setRange(low, end, low, end, low, end, value<T>(6));
  tile.setIRange(low, end, end - 1, end - 1, value<T>(7));
  tile.setJRange(end - 1, low, end, end - 1, value<T>(7));
  tile.setKRange(end - 1, end - 1, low, end, value<T>(7));
  tile.copyRange(low, end - 1, low, end - 1, low, end - 1, low + 1, end, low + 1, end, low + 1, end);
  for (int n = 0; n < kGuard; ++n) {
    ASSERT_EQ(block[n], value<T>(77)) << n;
    ASSERT_EQ(block[kGuard + TD::kSize + n], value<T>(77)) << n;
  }
}

// Every class of every layout compiles for every enabled element type.
#define VLN_INSTANTIATE_LAYOUT(T, E, H)                                                                      \
  static_assert(std::is_polymorphic_v<TileData<T, E, H>> && TileData<T, E, H>::kSize > 0);
#define VLN_INSTANTIATE_DYNAMIC(T, E, H) template class VLN::TileTree3D::DynamicTileData<TileData<T, E, H>>;

} // namespace

#define VLN_INSTANTIATE(type, name)                                                                          \
  VLN_INSTANTIATE_LAYOUT(type, 6, 1)                                                                         \
  VLN_INSTANTIATE_LAYOUT(type, 9, 0)                                                                         \
  VLN_INSTANTIATE_DYNAMIC(type, 4, 0)                                                                        \
  VLN_INSTANTIATE_DYNAMIC(type, 4, 1)                                                                        \
  VLN_INSTANTIATE_DYNAMIC(type, 4, 2)                                                                        \
  VLN_INSTANTIATE_DYNAMIC(type, 5, 0)                                                                        \
  VLN_INSTANTIATE_DYNAMIC(type, 5, 1)                                                                        \
  VLN_INSTANTIATE_DYNAMIC(type, 5, 2)                                                                        \
  VLN_INSTANTIATE_DYNAMIC(type, 6, 0) VLN_INSTANTIATE_DYNAMIC(type, 8, 0)                                    \
      VLN_INSTANTIATE_DYNAMIC(type, 8, 1)
VLN_FOR_EACH_ELEMENT_TYPE(VLN_INSTANTIATE)
