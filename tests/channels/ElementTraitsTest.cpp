#include "GeometryVolume/channels/ElementTraits.h"

#include <gtest/gtest.h>
#include <limits>
#include <type_traits>

namespace {

using namespace VLN::TileTree3D;
using namespace Velorn::Math;

template <class T> using Blend = typename ElementTraits<T>::Blend;

TEST(ElementTraits, RequirementBlendTypes) {
  EXPECT_TRUE((std::is_same_v<Blend<float>, float>));
  EXPECT_TRUE((std::is_same_v<Blend<signed char>, float>));
  EXPECT_TRUE((std::is_same_v<Blend<unsigned short>, float>));
  EXPECT_TRUE((std::is_same_v<Blend<int>, double>));
  EXPECT_TRUE((std::is_same_v<Blend<std::uint64_t>, double>));
  EXPECT_TRUE((std::is_same_v<Blend<double3>, double>));
  EXPECT_TRUE((std::is_same_v<Blend<int3>, double>));
  EXPECT_TRUE((std::is_same_v<Blend<float4x4>, float>));
  EXPECT_EQ(ElementTraits<float4x2>::kComponents, 8);
  EXPECT_EQ(ElementTraits<float3x3>::kRows, 3);
  EXPECT_EQ(ElementTraits<float>::kComponents, 1);
}

template <class T> void expectSaturates() {
  using Limits = std::numeric_limits<T>;
  using Traits = ElementTraits<T>;
  using B = Blend<T>;
  EXPECT_EQ(Traits::fromBlend(std::numeric_limits<B>::infinity()), Limits::max());
  EXPECT_EQ(Traits::fromBlend(-std::numeric_limits<B>::infinity()), Limits::min());
  EXPECT_EQ(Traits::fromBlend(static_cast<B>(Limits::max()) * 2), Limits::max());
  EXPECT_EQ(Traits::fromBlend(std::numeric_limits<B>::quiet_NaN()), T(0));
  EXPECT_EQ(Traits::fromBlend(B(1.75)), T(1));
  // What the blend type holds exactly comes back.
  EXPECT_EQ(Traits::fromBlend(Traits::toBlend(Limits::min())), Limits::min());
  EXPECT_EQ(Traits::fromBlend(Traits::toBlend(Limits::max())), Limits::max());
}

TEST(ElementTraits, BoundaryIntegersSaturate) {
  expectSaturates<signed char>();
  expectSaturates<unsigned char>();
  expectSaturates<short>();
  expectSaturates<unsigned short>();
  expectSaturates<int>();
  expectSaturates<unsigned int>();
  expectSaturates<std::int64_t>();
  expectSaturates<std::uint64_t>();
}

TEST(ElementTraits, RequirementBlendsByComponent) {
  float3 const a{0, 10, 20}, b{1, 20, 40};
  EXPECT_EQ(ElementTraits<float3>::lerp(a, b, 0.25f), (float3{0.25f, 12.5f, 25.0f}));
  EXPECT_EQ(ElementTraits<float3>::scaled(b, 2.0f), (float3{2, 40, 80}));
  EXPECT_EQ(ElementTraits<unsigned char>::lerp(255, 0, 0.5f), 127);
  EXPECT_EQ(ElementTraits<int3>::lerp({0, -4, 8}, {2, -8, 9}, 0.5), (int3{1, -6, 8}));
}

TEST(ElementTraits, RequirementDistance) {
  EXPECT_EQ(ElementTraits<float3>::distance({0, 0, 0}, {1, 2, 2}), 3.0);
  EXPECT_EQ(ElementTraits<float>::distance(1.5f, -1.0f), 2.5);
  constexpr auto big = std::numeric_limits<std::int64_t>::max();
  EXPECT_EQ(ElementTraits<std::int64_t>::distance(big, big - 1), 1.0);
  EXPECT_EQ(ElementTraits<std::int64_t>::distance(big, -big), 18446744073709551614.0);
  EXPECT_EQ(ElementTraits<unsigned char>::distance(3, 250), 247.0);
}

} // namespace
