#include "Render/Colors.h"

#include <algorithm>
#include <cmath>

namespace VLN::Render {

namespace {

constexpr int kAnchors = 33;

struct Table {
  char const* name;
  std::uint32_t anchors[kAnchors];
};

// Each at 33 equal steps; in between they are at most 5 of 255 off.
constexpr Table kTables[] = {
    // N. Smith, S. van der Walt, viridis of matplotlib, CC0.
    {"viridis", {0x440154, 0x470d60, 0x48186a, 0x482374, 0x472d7b, 0x453781, 0x424086, 0x3e4989, 0x3b528b,
                 0x375b8d, 0x33638d, 0x2f6b8e, 0x2c728e, 0x297a8e, 0x26828e, 0x23898e, 0x21918c, 0x1f988b,
                 0x1fa088, 0x22a785, 0x28ae80, 0x32b67a, 0x3fbc73, 0x4ec36b, 0x5ec962, 0x70cf57, 0x84d44b,
                 0x98d83e, 0xaddc30, 0xc2df23, 0xd8e219, 0xece51b, 0xfde725}},
    // the same.
    {"inferno", {0x000004, 0x040312, 0x0b0724, 0x150b37, 0x210c4a, 0x2f0a5b, 0x3d0965, 0x4a0c6b, 0x57106e,
                 0x64156e, 0x71196e, 0x7d1e6d, 0x8a226a, 0x972766, 0xa32c61, 0xb0315b, 0xbc3754, 0xc73e4c,
                 0xd24644, 0xdb503b, 0xe45a31, 0xeb6628, 0xf1731d, 0xf68013, 0xf98e09, 0xfb9d07, 0xfcac11,
                 0xfbbc21, 0xf9cb35, 0xf5db4c, 0xf2ea69, 0xf3f68a, 0xfcffa4}},
    // the same.
    {"magma", {0x000004, 0x030312, 0x0a0822, 0x130d34, 0x1d1147, 0x29115a, 0x36106b, 0x440f76, 0x51127c,
               0x5d177f, 0x6a1c81, 0x762181, 0x832681, 0x902a81, 0x9c2e7f, 0xaa337d, 0xb73779, 0xc43c75,
               0xd0416f, 0xdc4869, 0xe75263, 0xef5d5e, 0xf56b5c, 0xf9795d, 0xfc8961, 0xfd9869, 0xfea772,
               0xfeb67c, 0xfec488, 0xfed395, 0xfde2a3, 0xfcf0b2, 0xfcfdbf}},
    // J. Nunez, C. Anderton, R. Renslow, "Optimizing colormaps with consideration for color vision
    // deficiency", 2018.
    {"cividis", {0x002051, 0x00265d, 0x012b65, 0x083169, 0x11366c, 0x1c3c6e, 0x26426e, 0x31476e, 0x3c4d6e,
                 0x47536d, 0x51586e, 0x5a5e6e, 0x62646f, 0x6a6a70, 0x727071, 0x797673, 0x7f7c75, 0x868276,
                 0x8c8877, 0x938e78, 0x9a9478, 0xa19b78, 0xa9a177, 0xb2a874, 0xbbaf71, 0xc5b66d, 0xcebd68,
                 0xd8c462, 0xe2cb5c, 0xebd355, 0xf3da4f, 0xfae249, 0xfdea45}},
    // A. Mikhailov, "Turbo, An Improved Rainbow Colormap for Visualization", 2019.
    {"turbo", {0x23171b, 0x3e2a71, 0x493eae, 0x4a53d7, 0x4569ee, 0x3c7ff8, 0x3295f7, 0x2ba9ef, 0x26bce1,
               0x25cdcf, 0x29dcbc, 0x32e9a7, 0x3ff393, 0x50f980, 0x65fd6e, 0x7cfd5e, 0x95fb51, 0xadf545,
               0xc5ec3c, 0xdae034, 0xecd12e, 0xfac029, 0xffad24, 0xff9821, 0xff821d, 0xfd6c1a, 0xf05616,
               0xdf4111, 0xcb2f0d, 0xb61f07, 0xa31302, 0x950c00, 0x900c00}},
    // computed by the formulas of K. Moreland, "Diverging Color Maps for Scientific Visualization", 2009.
    {"coolwarm", {0x3b4cc0, 0x445acc, 0x4e68d7, 0x5875e1, 0x6282ea, 0x6c8ef1, 0x779af7, 0x82a5fb, 0x8db0fe,
                  0x98b9ff, 0xa3c2fe, 0xaec9fd, 0xb8d0f9, 0xc2d5f4, 0xccd9ee, 0xd5dbe6, 0xdddddd, 0xe5d8d1,
                  0xecd3c6, 0xf1ccb9, 0xf5c4ad, 0xf7bba0, 0xf7b194, 0xf7a687, 0xf49a7b, 0xf18d6f, 0xec7f63,
                  0xe57057, 0xde614c, 0xd55042, 0xcb3e38, 0xc0282f, 0xb40426}},
    {"gray", {0}},
};

float toLinear(float s) { return s <= 0.04045f ? s / 12.92f : std::pow((s + 0.055f) / 1.055f, 2.4f); }

} // namespace

std::uint8_t toSrgbByte(float linear) {
  float const c = std::clamp(linear, 0.0f, 1.0f);
  float const s = c <= 0.0031308f ? 12.92f * c : 1.055f * std::pow(c, 1 / 2.4f) - 0.055f;
  return static_cast<std::uint8_t>(std::lround(255 * s));
}

Vec3 fromSrgb(std::uint32_t rgb) {
  return {toLinear(static_cast<float>(rgb >> 16 & 255) / 255),
          toLinear(static_cast<float>(rgb >> 8 & 255) / 255), toLinear(static_cast<float>(rgb & 255) / 255)};
}

std::vector<std::string> colorMapNames() {
  std::vector<std::string> names;
  for (Table const& table : kTables) names.emplace_back(table.name);
  return names;
}

bool colorMap(std::string const& name, std::array<Vec3, 256>& colors) {
  auto const* const table =
      std::find_if(std::begin(kTables), std::end(kTables), [&](Table const& t) { return name == t.name; });
  if (table == std::end(kTables)) return false;
  for (int n = 0; n < 256; ++n) {
    float const t = static_cast<float>(n) / 255;
    Vec3 c{t, t, t};
    if (name != "gray") {
      int const a = std::min(n * (kAnchors - 1) / 255, kAnchors - 2);
      float const f = t * (kAnchors - 1) - static_cast<float>(a);
      for (int channel = 0; channel < 3; ++channel) {
        int const shift = 16 - 8 * channel;
        auto const p = static_cast<float>(table->anchors[a] >> shift & 255),
                   q = static_cast<float>(table->anchors[a + 1] >> shift & 255);
        c[channel] = ((q - p) * f + p) / 255;
      }
    }
    colors[n] = {toLinear(c.x), toLinear(c.y), toLinear(c.z)};
  }
  return true;
}

} // namespace VLN::Render
