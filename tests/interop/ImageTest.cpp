#include "Interop/ColorMap.h"
#include "support/PngReader.h"
#include "support/TempFolder.h"

#include <gtest/gtest.h>

#include <cmath>
#include <limits>
#include <set>

namespace {

using namespace VLN::Interop;
using namespace VLN::Test;

// Perceived lightness, 0 to 1: the L of Oklab, from its published forward matrices.
double lightness(Rgb const& c) {
  auto linear = [](std::uint8_t byte) {
    double const s = byte / 255.0;
    return s <= 0.04045 ? s / 12.92 : std::pow((s + 0.055) / 1.055, 2.4);
  };
  double const r = linear(c.r), g = linear(c.g), b = linear(c.b);
  double const l = std::cbrt(0.4122214708 * r + 0.5363325363 * g + 0.0514459929 * b);
  double const m = std::cbrt(0.2119034982 * r + 0.6806995451 * g + 0.1073969566 * b);
  double const s = std::cbrt(0.0883024619 * r + 0.2817188376 * g + 0.6299787005 * b);
  return 0.2104542553 * l + 0.7936177850 * m - 0.0040720468 * s;
}

// requirement
TEST(ImageTest, APngHoldsWhatWasDrawn) {
  TempFolder folder;
  Image image(7, 5, {1, 2, 3});
  image.fill(-3, 1, 4, 100, {200, 100, 50});
  image(6, 0) = {255, 0, 128};
  image.writePng(folder / "a.png");
  Image const read = readPng(folder / "a.png");
  ASSERT_EQ(read.width(), 7);
  ASSERT_EQ(read.height(), 5);
  for (int y = 0; y < 5; ++y)
    for (int x = 0; x < 7; ++x) EXPECT_EQ(read(x, y), image(x, y)) << x << ", " << y;
  EXPECT_EQ(folder.names(), std::vector<std::string>{"a.png"});
}

// boundary
TEST(ImageTest, TextAndPastesAreCutToThePicture) {
  Image image(20, 9);
  image.text(-4, -3, "0123456789", {0, 0, 0}, 2);
  image.text(15, 5, "8", {0, 0, 0});
  image.paste(Image(50, 50, {9, 9, 9}), 18, -10);
  EXPECT_EQ(image(19, 8), (Rgb{9, 9, 9}));
  EXPECT_EQ(Image::textWidth("12"), 11);
  EXPECT_EQ(Image::textWidth(""), 0);
  EXPECT_THROW(Image(0, 4), std::invalid_argument);
}

// requirement: all digits can be told apart
TEST(ImageTest, EachCharacterLooksDifferent) {
  std::set<std::vector<bool>> looks;
  for (char c :
       std::string("0123456789.-+einfa>ABCDEFGHIJKLMNOPQRSTUVWXYZbcdghjklmopqrstuvwxyz_=:,/()[]|<%#?")) {
    Image image(5, 7);
    image.text(0, 0, std::string(1, c), {0, 0, 0});
    std::vector<bool> look;
    for (int y = 0; y < 7; ++y)
      for (int x = 0; x < 5; ++x) look.push_back(image(x, y) == Rgb{0, 0, 0});
    EXPECT_TRUE(looks.insert(look).second) << c;
  }
}

// requirement: the sequential table grows lighter step by step, the diverging one from both ends to the
// middle
TEST(ColorMapTest, LightnessRunsEvenly) {
  auto const& sequential = colorTable(ColorMap::Kind::kSequential);
  auto const& diverging = colorTable(ColorMap::Kind::kDiverging);
  constexpr double kRounding = 0.004; // of a colour to whole bytes
  for (std::size_t n = 0; n < 256; ++n)
    EXPECT_NEAR(lightness(sequential[n]), 0.24 + 0.69 * double(n) / 255, kRounding) << n;
  for (std::size_t n = 0; n < 128; ++n) {
    double const expected = 0.97 - 0.55 * (127.5 - double(n)) / 127.5;
    EXPECT_NEAR(lightness(diverging[n]), expected, kRounding) << n;
    EXPECT_NEAR(lightness(diverging[255 - n]), expected, kRounding) << n;
  }
  EXPECT_GT(diverging[0].b, diverging[0].r);
  EXPECT_GT(diverging[255].r, diverging[255].b);
}

// boundary
TEST(ColorMapTest, ZeroIsTheMiddleOfSignedValues) {
  ColorMap const map = ColorMap::forRange(-1, 4);
  EXPECT_EQ(map.kind(), ColorMap::Kind::kDiverging);
  EXPECT_EQ(map.low(), -4);
  EXPECT_EQ(map.high(), 4);
  EXPECT_GT(lightness(map.color(0)), 0.96);
  EXPECT_EQ(ColorMap::forRange(0, 4).kind(), ColorMap::Kind::kSequential);
  EXPECT_EQ(ColorMap::forRange(-4, 0).kind(), ColorMap::Kind::kSequential);
}

// boundary
TEST(ColorMapTest, TakesAnyNumber) {
  ColorMap const flat = ColorMap::forRange(3, 3);
  EXPECT_LT(flat.low(), 3);
  EXPECT_GT(flat.high(), 3);
  ColorMap const zero = ColorMap::forRange(0, 0);
  EXPECT_LT(zero.low(), zero.high());
  ColorMap const map = ColorMap::forRange(0, 1);
  double const infinity = std::numeric_limits<double>::infinity();
  EXPECT_EQ(map.color(-infinity), map.color(0));
  EXPECT_EQ(map.color(infinity), map.color(1));
  EXPECT_EQ(map.color(std::nan("")), ColorMap::notANumber());
  EXPECT_GE(map.scale(1).height(), 1);
}

} // namespace
