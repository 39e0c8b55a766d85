// Fields cut into bricks of bytes: what they hold, where they are, and what they leave out.
#include "Render/Bricks.h"
#include "RenderCase.h"

#include <random>

namespace VLN::Test {
namespace {

using namespace Render;

float wave(double x, double y, double z) {
  return static_cast<float>(std::max(0.0, std::sin(0.31 * x) * std::cos(0.23 * y) + 0.4 * std::sin(0.4 * z)));
}
float ramp(double x, double y, double z) { return static_cast<float>(200 + 2 * x - y + 0.5 * z); }
bool checkered(int x, int y, int z) { return ((x >> 3) + (y >> 3) * 3 + (z >> 3)) % 3 == 0; }

// A reader of bricks written from the description in the header alone.
struct Unpacked {
  PackedField packed;

  explicit Unpacked(Field const& field, PackOptions const& options = {})
      : packed(packField(field, options)) {}
  double widthOf(PackedBrick const& b) const {
    return kPackedCore * packed.spacing * std::pow(4.0, double(b.level));
  }
  double cornerOf(PackedBrick const& b, int a) const {
    return packed.origin[a] + widthOf(b) * double(a == 0 ? b.x : a == 1 ? b.y : b.z);
  }
  /// Bricks that hold a local position.
  int countAt(Vec3d p, PackedBrick* found = nullptr, std::size_t* first = nullptr) const {
    int count = 0;
    std::size_t at = 0;
    for (PackedBrick const& b : packed.bricks) {
      bool holds = true;
      for (int a = 0; a < 3; ++a)
        holds = holds && p[a] >= cornerOf(b, a) && p[a] < cornerOf(b, a) + widthOf(b);
      if (holds) {
        ++count;
        if (found) *found = b, *first = at;
      }
      if (b.low < b.high) at += kPackedSamples;
    }
    return count;
  }
  /// @param off What the value may be off by.
  double value(Vec3d p, double background, double& off) const {
    PackedBrick b;
    std::size_t first = 0;
    off = 0;
    if (countAt(p, &b, &first) == 0) return background;
    off = (double(b.high) - double(b.low)) / 508;
    if (b.low == b.high) return double(b.low);
    double u[3], sum = 0;
    for (int a = 0; a < 3; ++a) u[a] = (p[a] - cornerOf(b, a)) / widthOf(b) * kPackedCore;
    for (int corner = 0; corner < 8; ++corner) {
      double weight = 1;
      std::size_t n = 0, stride = 1;
      for (int a = 0; a < 3; ++a, stride *= kPackedWidth) {
        double const whole = std::floor(u[a]), part = u[a] - whole;
        weight *= corner >> a & 1 ? part : 1 - part;
        // Beyond the last sample nothing weighs.
        n += stride * static_cast<std::size_t>(std::min(whole + (corner >> a & 1), 8.0));
      }
      sum += weight * packed.codes[first + n];
    }
    return double(b.low) + (double(b.high) - double(b.low)) * sum / 255;
  }
};

FlatCase const kCases[] = {{0, false, false, false}, {1, false, false, false}, {0, true, false, false},
                           {1, true, false, false},  {1, false, true, false},  {1, false, false, true}};

// requirement: within half a code, in every build of the buffer and at every depth of its tiles
TEST(Bricks, RequirementCodesRepeatTheField) {
  for (bool isMixed : {false, true})
    for (FlatCase const& flat : kCases) {
      RenderCase const volume(wave, -24, 40, flat, 0.125f,
                              isMixed ? checkered : std::function<bool(int, int, int)>());
      Field const field(volume.grid());
      Unpacked const bricks(field);
      ASSERT_GT(bricks.packed.bricks.size(), 300u);
      FieldPath path;
      std::mt19937 random(3);
      std::uniform_int_distribution<int> place(-26 * 16, 42 * 16);
      for (int n = 0; n < 1500; ++n) {
        Vec3d p{place(random) / 16.0, place(random) / 16.0, place(random) / 16.0};
        // Where depths meet, a coarse tile's blend is not that of its neighbour, from which samples come;
        // where tiles have codes of their own, their layer is not what the neighbour has.
        if (isMixed || flat.fp8) p = {std::floor(p.x), std::floor(p.y), std::floor(p.z)};
        p = p - field.origin();
        double off = 0;
        double const wanted = double(path.value(field.view(), p.as<float>()));
        double const got = bricks.value(p, double(field.background()), off);
        ASSERT_NEAR(got, wanted, off + 1e-5) << p.x << " " << p.y << " " << p.z << " halo " << flat.halo
                                             << " mixed " << isMixed << " coalesced " << flat.coalesce;
      }
    }
}

// requirement: no place is in two bricks, and what is not the background is in one
TEST(Bricks, RequirementBricksDoNotOverlap) {
  RenderCase const volume(sphereOf(20, {5, 3, 4}), -24, 40, {}, 3, checkered);
  Field const field(volume.grid());
  for (int depth : {28, 27, 26, 24, 20}) {
    Unpacked const bricks(field, {depth});
    FieldPath path;
    int inside = 0;
    for (int z = -28; z < 44; z += 3)
      for (int y = -28; y < 44; y += 3)
        for (int x = -28; x < 44; x += 3) {
          Vec3d const p = Vec3d{double(x), double(y), double(z)} - field.origin();
          int const count = bricks.countAt(p);
          ASSERT_LE(count, 1);
          if (path.value(field.view(), p.as<float>()) != field.background()) {
            ASSERT_EQ(count, 1) << x << " " << y << " " << z << " depth " << depth;
            ++inside;
          }
        }
    EXPECT_GT(inside, 500);
  }
}

// requirement: coarser depths, those above the roots too, are means over the samples next to them
TEST(Bricks, RequirementCoarseDepthsAreMeans) {
  RenderCase const volume(ramp, -24, 40, {}, 0);
  Field const field(volume.grid());
  std::size_t last = ~std::size_t(0);
  EXPECT_EQ(finestDepth(field), 28);
  for (int depth : {27, 26, 25, 23}) {
    Unpacked const bricks(field, {depth});
    EXPECT_LE(bricks.packed.bricks.size(), last);
    last = bricks.packed.bricks.size();
    // A tent keeps what is linear, away from the box's sides.
    std::mt19937 random(5);
    int const margin = 2 << (28 - depth);
    if (margin > 28) continue;
    std::uniform_real_distribution<double> place(-24.0 + margin, 39.0 - margin);
    for (int n = 0; n < 300; ++n) {
      Vec3d const p{place(random), place(random), place(random)};
      double off = 0;
      double const got = bricks.value(p - field.origin(), 0, off);
      ASSERT_NEAR(got, double(ramp(p.x, p.y, p.z)), off + 1e-3) << "depth " << depth;
    }
  }
}

// boundary
TEST(Bricks, BoundaryNothingAndTooMuch) {
  RenderCase const empty([](double, double, double) { return 0.5f; }, 0, 16, {}, 0.5f);
  EXPECT_TRUE(packField(Field(empty.grid()), {}).bricks.empty());
  RenderCase const one([](double, double, double) { return 2.0f; }, 0, 16);
  PackedField const constant = packField(Field(one.grid()), {});
  std::size_t coded = 0;
  for (PackedBrick const& b : constant.bricks) coded += b.low < b.high;
  EXPECT_EQ(constant.codes.size(), coded * kPackedSamples);
  EXPECT_LT(coded, constant.bricks.size()) << "what is one value has no codes";
  PackedField const most = packField(Field(one.grid()), {28, 3});
  EXPECT_GT(most.bricks.size(), 3u);
  EXPECT_TRUE(most.codes.empty());
}

// regression: zeros beside values of both signs became a little less or more, and surfaces of nothing
TEST(Bricks, RegressionZeroStaysZero) {
  auto const plateau = [](double x, double y, double z) {
    double const d = std::sqrt(x * x + y * y + z * z) - 9.3;
    return static_cast<float>(d < 0 ? std::max(d, -2.7) : std::max(0.0, std::min(d - 4, 3.1)));
  };
  RenderCase const volume(plateau, -24, 24, {}, 3.1f);
  Field const field(volume.grid());
  Unpacked const bricks(field);
  int zeros = 0, signs = 0;
  for (int z = -20; z < 20; ++z)
    for (int y = -20; y < 20; ++y)
      for (int x = -20; x < 20; x += 3) {
        double off = 0;
        double const got = bricks.value(Vec3d{double(x), double(y), double(z)} - field.origin(), 3.1, off);
        ASSERT_NEAR(got, double(plateau(x, y, z)), off + 1e-6);
        if (plateau(x, y, z) != 0) continue;
        ++zeros, signs += off > 0;
        ASSERT_NEAR(got, 0, 1e-6) << x << " " << y << " " << z;
      }
  EXPECT_GT(zeros, 1000);
  EXPECT_GT(signs, 500);
}

// boundary: ranges of values that no float holds
TEST(Bricks, BoundaryHugeValuesStayFinite) {
  RenderCase const volume([](double x, double, double) { return x < 8 ? -3e38f : 3e38f; }, 0, 16);
  for (int depth : {28, 27})
    for (PackedBrick const& b : packField(Field(volume.grid()), {depth}).bricks) {
      EXPECT_TRUE(std::isfinite(b.high - b.low));
      EXPECT_LE(b.high, 1.01e38f);
      EXPECT_GE(b.low, -1.01e38f);
    }
}

// requirement
TEST(Bricks, RequirementThreadsDoNotMatter) {
  RenderCase const volume(wave, -24, 40, {}, 0.125f, checkered);
  Field const field(volume.grid());
  for (int depth : {28, 26}) {
    PackedField const one = packField(field, {depth, 1 << 20, 1});
    for (int threads : {2, 8}) {
      PackedField const many = packField(field, {depth, 1 << 20, threads});
      EXPECT_EQ(one.codes, many.codes);
      ASSERT_EQ(one.bricks.size(), many.bricks.size());
      for (std::size_t n = 0; n < one.bricks.size(); ++n) {
        EXPECT_EQ(one.bricks[n].low, many.bricks[n].low);
        EXPECT_EQ(one.bricks[n].high, many.bricks[n].high);
      }
    }
  }
}

} // namespace
} // namespace VLN::Test
