// What rays need beside the buffer: bricks, bounds, weights, and the walk that skips by them.
#include "Render/Walk.h"
#include "RenderCase.h"

#include <random>

namespace VLN::Test {
namespace {

using namespace Render;

float wave(double x, double y, double z) {
  return static_cast<float>(std::max(0.0, std::sin(0.31 * x) * std::cos(0.23 * y) + 0.4 * std::sin(0.4 * z)));
}
bool checkered(int x, int y, int z) { return ((x >> 3) + (y >> 3) * 3 + (z >> 3)) % 3 == 0; }

FlatCase const kCases[] = {{0, false, false, false}, {1, false, false, false}, {0.4f, false, false, false},
                           {0, true, false, false},  {1, true, false, false},  {1, false, true, false},
                           {0, false, false, true},  {1, false, false, true}};

// requirement: the bricks give what the reader's own blends give, bit for bit
TEST(Field, RequirementReadsWhatTheCursorReads) {
  for (bool isMixed : {false, true})
    for (FlatCase const& flat : kCases) {
      RenderCase const volume(wave, -24, 40, flat, 0.125f,
                              isMixed ? checkered : std::function<bool(int, int, int)>());
      Field field(volume.grid());
      nanovtt::GridCursor cursor(volume.grid());
      FieldPath path;
      std::mt19937 random(7);
      std::uniform_int_distribution<int> place(-24 * 64, 39 * 64);
      for (int n = 0; n < 3000; ++n) {
        Vec3 const p{float(place(random)) / 64, float(place(random)) / 64, float(place(random)) / 64};
        float const got = path.value(field.view(), (p.as<double>() - field.origin()).as<float>());
        ASSERT_EQ(got, cursor.trilinear(p.x, p.y, p.z))
            << p.x << " " << p.y << " " << p.z << " halo " << flat.halo << " mixed " << isMixed
            << " coalesced " << flat.coalesce << " textures " << flat.textures << " codes " << flat.fp8;
      }
    }
}

// requirement
TEST(Field, RequirementBoundsHoldForEveryBlend) {
  for (FlatCase const& flat : kCases) {
    RenderCase const volume(wave, -24, 40, flat, 0.125f, checkered);
    Field field(volume.grid());
    FieldPath path;
    std::mt19937 random(8);
    std::uniform_real_distribution<float> place(-24, 39);
    for (int n = 0; n < 5000; ++n) {
      Vec3 const p{place(random), place(random), place(random)};
      float const v = path.value(field.view(), (p.as<double>() - field.origin()).as<float>());
      ASSERT_GT(path.height, 0);
      for (int level = 0; level < path.height; ++level) {
        std::uint32_t const tile = path.level[level].tile;
        // A blend of equal numbers may be a rounding off.
        ASSERT_LE(field.bounds().low(tile), v + 1e-6f) << "level " << level;
        ASSERT_GE(field.bounds().high(tile), v - 1e-6f) << "level " << level;
      }
    }
  }
}

// requirement: bounds are no wider than two codes beyond the samples
TEST(Field, RequirementBoundsAreNarrow) {
  RenderCase const volume(wave, 0, 32);
  Field field(volume.grid());
  double const code = (double(field.high()) - double(field.low())) / 65535;
  auto const grid = volume.grid();
  grid.container().forEachTile([&](nanovtt::TileRef const& tile) {
    if (tile.depth != nanovtt::kMaxDepth) return;
    float low = 1e9f, high = -1e9f;
    for (int k = 0; k <= 4; ++k)
      for (int j = 0; j <= 4; ++j)
        for (int i = 0; i <= 4; ++i) {
          auto const v =
              static_cast<float>(grid.valueAt(tile.corner.x + i, tile.corner.y + j, tile.corner.z + k));
          low = std::min(low, v), high = std::max(high, v);
        }
    float const from = field.bounds().low(tile.number), to = field.bounds().high(tile.number);
    EXPECT_LE(from, low);
    EXPECT_GE(to, high);
    EXPECT_GT(from, double(low) - 2 * code);
    EXPECT_LT(to, double(high) + 2 * code);
  });
}

// requirement: a mean is that of the finest samples below
TEST(Field, RequirementMeansAreThoseOfTheFinest) {
  RenderCase const volume(wave, 0, 64);
  Field field(volume.grid());
  double const halfCode = (double(field.high()) - double(field.low())) / 65535 / 2;
  auto const grid = volume.grid();
  grid.container().forEachTile([&](nanovtt::TileRef const& tile) {
    bool const isCovered = tile.corner.x >= 0 && tile.corner.y >= 0 && tile.corner.z >= 0 &&
                           tile.corner.x < 64 && tile.corner.y < 64 && tile.corner.z < 64;
    if (tile.depth != 26 || !isCovered) return; // the border's are covered in part
    double sum = 0;
    for (int k = 0; k < 16; ++k)
      for (int j = 0; j < 16; ++j)
        for (int i = 0; i < 16; ++i)
          sum += grid.valueAt(tile.corner.x + i, tile.corner.y + j, tile.corner.z + k);
    EXPECT_NEAR(field.bounds().mean(tile.number), sum / 4096, halfCode + 1e-6);
  });
}

// requirement: what is skipped has nothing, and what is not skipped comes once and in order
TEST(Walk, RequirementSkipsWhatDoesNotMatterAndNothingElse) {
  for (FlatCase const& flat : kCases) {
    RenderCase const volume(wave, -24, 40, flat, 0, checkered);
    Field field(volume.grid());
    auto const matters = [](float, float high) { return high > 0.7f ? high : 0.0f; };
    field.weigh(matters);
    FieldView const& view = field.view();
    std::mt19937 random(9);
    std::uniform_real_distribution<float> unit(-1, 1);
    std::int64_t pieces = 0;
    for (int n = 0; n < 400; ++n) {
      Vec3 const middle = (view.low + view.high) * 0.5f;
      Vec3 d = normalized(Vec3{unit(random), unit(random), unit(random)});
      if (n % 7 == 0) d.x = 0;
      if (n % 11 == 0) d = {0, 0, n % 2 ? 1.0f : -1.0f};
      Vec3 const o = middle + Vec3{unit(random), unit(random), unit(random)} * 30.0f - d * 90.0f;
      Ray const ray(o, d);
      Walk walk(view, ray, 0, 300);
      Segment s;
      std::vector<Segment> got;
      while (walk.next(s)) got.push_back(s);
      pieces += static_cast<std::int64_t>(got.size());
      for (std::size_t k = 0; k < got.size(); ++k) {
        ASSERT_LT(got[k].t0, got[k].t1);
        if (k > 0) { ASSERT_GE(got[k].t0, got[k - 1].t1); }
        EXPECT_GT(got[k].weight, 0);
      }
      FieldPath path;
      std::size_t at = 0;
      for (float t = 40; t < 140; t += 0.173f) {
        Vec3 const p = ray.at(t);
        float const v = path.value(view, p);
        while (at < got.size() && got[at].t1 < t) ++at;
        bool const covered = at < got.size() && got[at].t0 <= t;
        if (v > 0.70001f) { ASSERT_TRUE(covered) << "ray " << n << " at " << t << " value " << v; }
        if (covered) {
          ASSERT_NEAR(trilinear(got[at].brick, got[at].samples(p)), v, 1e-3f) << "ray " << n << " at " << t;
        }
      }
    }
    EXPECT_GT(pieces, 1000);
  }
}

// requirement
TEST(Field, RequirementSameForAnyNumberOfThreads) {
  RenderCase const volume(wave, -24, 40, {0.4f}, 0, checkered);
  Field one(volume.grid(), {-1, 1});
  one.weigh([](float low, float high) { return high - low; }, 1);
  for (int threads : {2, 8}) {
    Field many(volume.grid(), {-1, threads});
    many.weigh([](float low, float high) { return high - low; }, threads);
    ASSERT_EQ(one.tileCount(), many.tileCount());
    for (std::uint32_t n = 0; n < one.tileCount(); ++n) {
      for (int c = 0; c < 3; ++c) ASSERT_EQ(one.bounds().code(n, c), many.bounds().code(n, c));
      ASSERT_EQ(one.view().weights[n], many.view().weights[n]);
      ASSERT_EQ(one.view().cells[n], many.view().cells[n]);
    }
  }
}

// boundary: what is no number counts as the background
TEST(Field, BoundaryNumbersThatAreNone) {
  RenderCase const volume(
      [](double x, double y, double z) {
        return x == 5 ? std::nanf("") : y == 5 ? INFINITY : static_cast<float>(z);
      },
      0, 16, {}, 3);
  Field field(volume.grid());
  FieldPath path;
  Vec3d const o = field.origin();
  EXPECT_EQ(path.value(field.view(), (Vec3d{5, 2, 2} - o).as<float>()), 3);
  EXPECT_EQ(path.value(field.view(), (Vec3d{2, 5, 2} - o).as<float>()), 3);
  EXPECT_EQ(path.value(field.view(), (Vec3d{2, 2, 7} - o).as<float>()), 7);
  EXPECT_EQ(field.low(), 0);
  EXPECT_EQ(field.high(), 15);
}

// negative
TEST(Field, NegativeComponentsThatAreNotThere) {
  RenderCase const volume(wave, 0, 8);
  EXPECT_THROW(Field(volume.grid(), {1}), std::invalid_argument);
}

} // namespace
} // namespace VLN::Test
