// Bounds and means of tiles: made, read, damaged; and what coarse pictures make of them.
#include "Render/Bounds.h"
#include "Render/Fog.h"
#include "RenderCase.h"

#include <random>

namespace VLN::Test {
namespace {

using namespace Render;
using nanovtt::BoundsReader;

float wave(double x, double y, double z) {
  return static_cast<float>(std::max(0.0, std::sin(0.31 * x) * std::cos(0.23 * y) + 0.4 * std::sin(0.4 * z)));
}
bool checkered(int x, int y, int z) { return ((x >> 3) + (y >> 3) * 3 + (z >> 3)) % 3 == 0; }

FlatCase const kCases[] = {{0, false, false, false}, {1, false, false, false}, {0.4f, false, false, false},
                           {0, true, false, false},  {1, true, false, false},  {1, false, true, false},
                           {0, false, false, true},  {1, false, false, true}};

// requirement: those of a buffer are those that a field makes for itself, and they are sound
TEST(Bounds, RequirementSameBesideTheBufferAndInTheField) {
  for (FlatCase const& flat : kCases) {
    RenderCase const volume(wave, -24, 40, flat, 0.125f, checkered);
    auto const grid = volume.grid();
    auto const made = makeBounds(grid);
    ASSERT_TRUE(BoundsReader::check(made.data(), made.size(), grid.container()).ok());
    BoundsReader const reader(made.data());
    Field const own(grid), given(grid, {-1, 0, made.data()});
    ASSERT_EQ(own.low(), given.low());
    ASSERT_EQ(own.high(), given.high());
    for (std::uint32_t n = 0; n < own.tileCount(); ++n)
      for (int c = 0; c < nanovtt::kBoundsRowCodes; ++c)
        ASSERT_EQ(own.bounds().code(n, c), reader.code(n, c)) << n;
    for (int a = 0; a < 3; ++a) {
      ASSERT_EQ(own.activeLow()[a], given.activeLow()[a]);
      ASSERT_EQ(own.activeHigh()[a], given.activeHigh()[a]);
    }
  }
}

// requirement: eight bits are wider, never narrower, and the picture of a surface is the same
TEST(Bounds, RequirementOfEightBitsHoldThoseOfSixteen) {
  RenderCase const volume(sphereOf(14), -24, 24, {}, 3);
  auto const grid = volume.grid();
  auto const narrow = makeBounds(grid), wide = makeBounds(grid, {-1, 8, 0});
  ASSERT_TRUE(BoundsReader::check(wide.data(), wide.size(), grid.container()).ok());
  EXPECT_LT(wide.size(), narrow.size() * 6 / 10);
  BoundsReader const a(narrow.data()), b(wide.data());
  for (std::uint32_t n = 0; n < grid.container().tileCount(); ++n) {
    ASSERT_LE(b.low(n), a.low(n) + 1e-4f);
    ASSERT_GE(b.high(n), a.high(n) - 1e-4f);
    ASSERT_NEAR(b.mean(n), a.mean(n), 0.05f);
  }
  RenderOptions options;
  options.width = options.height = 96, options.mode = Mode::kSurface;
  Field one(grid, {-1, 0, narrow.data()}), other(grid, {-1, 0, wide.data()}), own(grid);
  auto const camera = frontCamera(60, 40);
  auto const first = toBytes(render(own, {}, camera, options), {0, 0, 0}, true);
  EXPECT_EQ(first, toBytes(render(one, {}, camera, options), {0, 0, 0}, true));
  EXPECT_EQ(first, toBytes(render(other, {}, camera, options), {0, 0, 0}, true));
}

// requirement: the same bytes at any number of threads
TEST(Bounds, RequirementSameForAnyNumberOfThreads) {
  RenderCase const volume(wave, -24, 40, {0.4f}, 0, checkered);
  auto const one = makeBounds(volume.grid(), {-1, 16, 1});
  for (int threads : {2, 8}) EXPECT_EQ(one, makeBounds(volume.grid(), {-1, 16, threads}));
}

// negative: what is not their form is told
TEST(Bounds, NegativeDamagedBytes) {
  RenderCase const volume(wave, 0, 16);
  auto const tree = volume.grid().container();
  auto const sound = makeBounds(volume.grid());
  auto const fault = [&](std::size_t at, auto value, std::size_t length) {
    auto bytes = sound;
    nanovtt::store(bytes.data() + at, value);
    auto const answer = BoundsReader::check(bytes.data(), length, tree);
    return std::string(answer.ok() ? "" : answer.message);
  };
  EXPECT_EQ(fault(0, std::uint32_t(1), sound.size()), "bounds of another number of tiles");
  EXPECT_EQ(fault(4, std::uint32_t(12), sound.size()), "bits of bounds");
  EXPECT_EQ(fault(4, std::uint32_t(8), sound.size()), "length of bounds");
  EXPECT_EQ(fault(8, std::nanf(""), sound.size()), "range of all bounds");
  EXPECT_EQ(fault(8, 1e30f, sound.size()), "range of all bounds");
  EXPECT_EQ(fault(20, std::uint32_t(0), 47), "bounds shorter than their header");
  EXPECT_EQ(fault(20, std::uint32_t(0), sound.size() - 1), "length of bounds");
  // The last tile's range reaches beyond its parent's, or ends before it begins.
  std::size_t const last = sound.size() - 2 * nanovtt::kBoundsRowCodes;
  EXPECT_EQ(fault(last, std::uint32_t(0xFFFF0000), sound.size()), "bounds of a tile");
  EXPECT_EQ(fault(last, std::uint32_t(0x00010002), sound.size()), "bounds of a tile");
}

// Sum of the optical depths of rays along z, a unit apart.
double totalDepth(FogView const& fog, Vec3d origin, int low, int high) {
  double sum = 0;
  for (double y = low; y < high; y += 1)
    for (double x = low; x < high; x += 1)
      sum += double(
          opticalDepth(fog, Ray((Vec3d{x + 0.61, y + 0.07, high + 50.0} - origin).as<float>(), {0, 0, -1}), 0,
                       1e6f, 0.2f));
  return sum;
}

// A thin fog: strands and sheets of one sample, most of which coarse samples at corners miss or overrate.
float thin(double x, double y, double z) {
  return (x == 5 || (int(y) % 7 == 3 && int(z) % 5 == 2)) ? 0.05f : 0.0f;
}

struct Totals {
  double fine, corners, means;
};
Totals totalsAt(int depth, FlatCase const& flat) {
  constexpr int kLow = -12, kHigh = 68; // as far as coarse samples reach
  RenderCase const volume(thin, 0, 56, flat);
  Field field(volume.grid());
  TransferOptions options;
  options.low = 0, options.high = 1;
  Transfer const transfer(options);
  auto const weigh = [&] {
    field.weigh([&](float low, float high) { return transfer.largestOpacity(low, high); });
  };
  FogView fog;
  fog.transfer = &transfer.view();
  Totals t{};
  weigh();
  fog.field = field.view();
  t.fine = totalDepth(fog, field.origin(), kLow, kHigh);
  fog.field.maxDepth = depth; // the same samples as they are stored
  t.corners = totalDepth(fog, field.origin(), kLow, kHigh);
  field.limitDepth(depth);
  weigh();
  fog.field = field.view();
  t.means = totalDepth(fog, field.origin(), kLow, kHigh);
  return t;
}

// requirement: a coarse picture of a thin fog is as opaque as the fine one
TEST(Means, RequirementCoarseFogIsAsOpaqueAsTheFine) {
  for (FlatCase const& flat : {FlatCase{1}, FlatCase{0}, FlatCase{1, true}})
    for (int depth : {27, 26, 25}) {
      Totals const t = totalsAt(depth, flat);
      std::string const label = "depth " + std::to_string(depth) + (flat.coalesce ? ", coalesced" : "");
      RecordProperty("fine " + label, std::to_string(t.fine));
      std::cout << label << ": fine " << t.fine << ", corner values " << t.corners << ", means " << t.means
                << '\n';
      EXPECT_NEAR(t.means / t.fine, 1, 0.04) << label;
    }
}

// requirement: a limit that is taken back leaves nothing behind
TEST(Means, RequirementLimitsCanBeTakenBack) {
  RenderCase const volume(wave, -24, 40, {0.4f}, 0.125f, checkered);
  Field once(volume.grid()), often(volume.grid());
  RenderOptions options;
  options.width = options.height = 64;
  options.transfer.high = once.high();
  auto const camera = frontCamera(120, 40);
  auto const picture = [&](Field& field, int depth) {
    options.depth = depth;
    return toBytes(render(field, {}, camera, options), {0, 0, 0}, true);
  };
  auto const fine = picture(once, 28);
  Field coarse(volume.grid());
  auto const at26 = picture(coarse, 26);
  EXPECT_NE(fine, at26);
  EXPECT_EQ(picture(often, 26), at26);
  EXPECT_EQ(picture(often, 25), picture(coarse, 25));
  EXPECT_EQ(picture(often, 28), fine);
  EXPECT_EQ(picture(often, 26), at26);
}

} // namespace
} // namespace VLN::Test
