// The two tree shapes as parameters of typed tests.
#pragma once

#include "GeometryVolume/tiletree/Traits.h"

#include <gtest/gtest.h>

#include <string>

namespace Support {

using Shapes = ::testing::Types<VLN::TileTree3D::PowerOfTwoTraits, VLN::TileTree3D::OddTraits>;

struct ShapeNames {
  template <class TraitsT> static std::string GetName(int) {
    return TraitsT::kTW == 2 ? "PowerOfTwo" : "Odd";
  }
};

} // namespace Support

/// Declares a test suite that runs for both shapes; its tests name the shape TypeParam.
#define VLN_SHAPE_SUITE(Suite)                                                                               \
  template <class> class Suite : public ::testing::Test {};                                                  \
  TYPED_TEST_SUITE(Suite, ::Support::Shapes, ::Support::ShapeNames)
