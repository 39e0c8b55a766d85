#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/topology/PointTopology.h"
#include "GeometryVolume/volume/ForEach.h"
#include "support/Print.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <cmath>
#include <limits>
#include <map>
#include <random>
#include <thread>

namespace VLN::Test {
namespace {

using namespace VLN::TileTree3D;

template <class Call> std::string messageOf(Call const& call) {
  try {
    call();
  } catch (std::exception const& e) { return e.what(); }
  return "nothing was thrown";
}

constexpr int kLow = -536870912, kHigh = 536870911;

TEST(VolumeTest, RequirementOneSetMakesOneFinestTileAndItsAncestors) {
  Volume volume;
  auto field = volume.addField<float>("density", 3);
  EXPECT_EQ(field.get(1, 2, 3), 3.0f);
  EXPECT_EQ(volume.tileCount(), 0);
  field.set(1, 2, 3, 0.5f);
  EXPECT_EQ(field.get(1, 2, 3), 0.5f);
  EXPECT_EQ(field.get(0, 2, 3), 3.0f);
  EXPECT_EQ(volume.tree().tileCount(28), 1);
  EXPECT_EQ(volume.tree().rootCount(), 1);
  EXPECT_EQ(volume.topology().tileCount(-1), volume.tileCount());
  EXPECT_EQ(field.channel().tileCount(-1), volume.tileCount());
}

TEST(VolumeTest, RequirementNamesAndTypesAreToldInOneLine) {
  Volume volume;
  volume.addField<float>("density", 0);
  volume.addField<int>("id", -1);
  EXPECT_EQ(volume.fieldNames(), (std::vector<std::string>{"density", "id"}));
  EXPECT_TRUE(volume.hasField("id"));
  EXPECT_TRUE(volume.hasField<int>("id"));
  EXPECT_FALSE(volume.hasField<float>("id"));
  EXPECT_FALSE(volume.hasField("x"));
  EXPECT_EQ(volume.field<int>("id").background(), -1);
  EXPECT_EQ(messageOf([&] { volume.addField<float>("density", 0); }),
            "the volume has a field \"density\" already");
  EXPECT_EQ(messageOf([&] { volume.addField<float>("", 0); }), "a field needs a name");
  EXPECT_EQ(messageOf([&] { volume.addField<float>("voxel_tile_tree", 0); }),
            "the name \"voxel_tile_tree\" is taken by another part of the volume");
  EXPECT_EQ(messageOf([&] { volume.field<float>("heat"); }), "the volume has no field \"heat\"");
  EXPECT_EQ(messageOf([&] { volume.field<float>("id"); }), "field \"id\" holds int32, not float");
  EXPECT_EQ(messageOf([&] { volume.removeField("heat"); }), "the volume has no field \"heat\"");
  volume.removeField("id");
  EXPECT_FALSE(volume.hasField("id"));
  volume.addField<float>("id", 2);
  EXPECT_EQ(volume.field<float>("id").get(0, 0, 0), 2.0f);
}

TEST(VolumeTest, BoundaryTheEndsOfTheDomainAndBeyond) {
  Volume volume;
  auto field = volume.addField<float>("f", -1);
  int const ends[] = {kLow, kHigh};
  for (int const x : ends)
    for (int const y : ends)
      for (int const z : ends) field.set(x, y, z, float(x > 0) + 2 * float(y > 0) + 4 * float(z > 0));
  for (int const x : ends)
    for (int const y : ends)
      for (int const z : ends)
        EXPECT_EQ(field.get(x, y, z), float(x > 0) + 2 * float(y > 0) + 4 * float(z > 0));
  for (int const far : {kLow - 1, kHigh + 1, INT32_MIN, INT32_MAX}) {
    EXPECT_EQ(field.get(far, 0, 0), -1.0f);
    EXPECT_EQ(field.get(0, far, 0), -1.0f);
    EXPECT_EQ(field.get(0, 0, far), -1.0f);
    EXPECT_THROW(field.set(far, 0, 0, 1), std::out_of_range);
    EXPECT_THROW(field.set(0, 0, far, 1), std::out_of_range);
    EXPECT_THROW(field.set(std::vector<int3>{{0, 0, 0}, {0, far, 0}}, std::vector<float>{1, 1}),
                 std::out_of_range);
    EXPECT_EQ(field.get(0, 0, 0), -1.0f) << "nothing of the call was done";
  }
  EXPECT_EQ(messageOf([&] { field.set(INT32_MAX, 0, -3, 1); }),
            "(2147483647, 0, -3) lies outside the domain of a volume");
}

TEST(VolumeTest, NegativeBulkSetWithoutAValueForEachPosition) {
  Volume volume;
  auto field = volume.addField<float>("f", 0);
  EXPECT_EQ(messageOf([&] {
              field.set(std::vector<int3>(3, int3{0, 0, 0}), std::vector<float>(2));
            }),
            "field \"f\": 3 positions with 2 values");
}

TEST(VolumeTest, RequirementNewTilesKeepWhatWasReadThereInAllFields) {
  Volume volume;
  auto coarse = volume.addField<float>("coarse", 9);
  auto other = volume.addField<float>("other", 0);
  // Depth 20 and no deeper, with values of its own there.
  volume.refineWhere(
      {0, 0, 0}, {512, 512, 512}, [](TileBox const&) { return true; }, 21);
  coarse.fill(5);
  EXPECT_EQ(coarse.get(100, 100, 100), 5.0f);
  other.set(100, 100, 100, 1);
  EXPECT_EQ(coarse.get(100, 100, 100), 5.0f);
  EXPECT_EQ(coarse.get(101, 100, 100), 5.0f);
  EXPECT_EQ(other.get(101, 100, 100), 0.0f);
  EXPECT_EQ(coarse.channel().tileCount(-1), volume.tileCount());
}

TEST(VolumeTest, RequirementTilesOfSeveralFieldsBecomeOne) {
  Volume volume;
  auto a = volume.addField<float>("a", 1), b = volume.addField<float>("b", 2);
  auto other = a; // a handle that has looked there before
  EXPECT_EQ(other.get(9, 9, 9), 1.0f);
  a.set(9, 9, 9, 10);
  other.set(10, 9, 9, 11);
  b.set(9, 10, 9, 20);
  b.set(400, 0, 0, 21);
  EXPECT_EQ(a.get(10, 9, 9), 11.0f);
  EXPECT_EQ(a.get(400, 0, 0), 1.0f);
  EXPECT_EQ(b.get(9, 9, 9), 2.0f);
  EXPECT_EQ(volume.tree().tileCount(Volume::Shape::kMaxDepth), 2);
  a.set(401, 0, 0, 12); // the tile has come with the other field
  EXPECT_EQ(volume.tree().tileCount(Volume::Shape::kMaxDepth), 2);
  EXPECT_EQ(a.get(401, 0, 0), 12.0f);
  // Tiles outlive the field that made them, and are in what is copied.
  b.set(-400, 0, 0, 22);
  Volume const copy = volume;
  EXPECT_EQ(copy.field<float>("b").get(-400, 0, 0), 22.0f);
  b.set(-800, 0, 0, 23);
  volume.removeField("b");
  EXPECT_EQ(volume.tileCount(), volume.tree().tileCount(-1));
  EXPECT_EQ(volume.tree().tileCount(Volume::Shape::kMaxDepth), 4);
  EXPECT_EQ(copy.tree().tileCount(Volume::Shape::kMaxDepth), 3);
  EXPECT_TRUE(volume.tree().checkConsistency(false));
}

TEST(VolumeTest, RequirementReadersMeetTilesThatTheTreeLacks) {
  for (int round = 0; round < 20; ++round) {
    Volume volume;
    auto a = volume.addField<float>("a", 0), b = volume.addField<float>("b", 0);
    for (int n = 0; n < 700; ++n) {
      a.set(6 * n, n % 5, 0, float(n));
      if (n % 2) b.set(6 * n, 4 + n % 5, 0, -float(n)); // in part the same tiles
    }
    std::atomic<int> wrong{0};
    std::vector<std::thread> threads;
    for (int t = 0; t < 4; ++t)
      threads.emplace_back([&, t] {
        Field<float> const ownA = a, ownB = b;
        for (int n = 0; n < 700; ++n) {
          if (n == 100 * t) wrong += volume.tree().tileCount(-1) <= 700;
          wrong += ownA.get(6 * n, n % 5, 0) != float(n);
          if (n % 2) wrong += ownB.get(6 * n, 4 + n % 5, 0) != -float(n);
        }
      });
    for (auto& thread : threads) thread.join();
    EXPECT_EQ(wrong.load(), 0);
  }
}

TEST(VolumeTest, RequirementCopiesAreIndependentAndObjectsKeepWhatTheyHave) {
  Volume volume;
  auto field = volume.addField<float>("f", 0);
  field.set(0, 0, 0, 1);
  Volume copy = volume;
  auto copied = copy.field<float>("f");
  VLN::Object const object = volume.object();
  EXPECT_EQ(copied.channel().tileArrays(), field.channel().tileArrays()) << "shared until written";
  field.set(0, 0, 0, 2);
  EXPECT_EQ(copied.get(0, 0, 0), 1.0f);
  copied.set(0, 0, 0, 3);
  copied.set(1000, 0, 0, 4);
  EXPECT_EQ(field.get(0, 0, 0), 2.0f);
  EXPECT_EQ(field.get(1000, 0, 0), 0.0f);
  Volume back(object);
  EXPECT_EQ(back.field<float>("f").get(0, 0, 0), 1.0f);
  EXPECT_EQ(back.fieldNames(), std::vector<std::string>{"f"});
  Volume moved = std::move(copy);
  EXPECT_EQ(copied.get(1000, 0, 0), 4.0f) << "the handle follows the volume";
  EXPECT_EQ(moved.field<float>("f").get(0, 0, 0), 3.0f);
}

TEST(VolumeTest, NegativeObjectsWithoutATree) {
  EXPECT_EQ(messageOf([] { Volume volume{VLN::Object()}; }),
            "the object holds no tile tree of 4 x 4 x 4 samples with a voxel topology");
}

TEST(VolumeTest, RequirementBulkIsTheSameForAnyNumberOfThreads) {
  std::mt19937 random(5);
  std::vector<int3> positions;
  std::vector<float> values;
  for (int n = 0; n < 60000; ++n) {
    auto const c = [&] { return static_cast<int>(random() % 40) - 20; }; // most positions come again
    positions.push_back({c(), c(), c()});
    values.push_back(float(n));
  }
  std::map<std::array<int, 3>, float> model;
  for (std::size_t n = 0; n < values.size(); ++n)
    model[{positions[n].x, positions[n].y, positions[n].z}] = values[n];
  std::vector<int3> order;
  for (int const threads : {1, 2, 8}) {
    Volume volume;
    auto field = volume.addField<float>("f", -1);
    VLN::withThreads(threads, [&] { field.set(positions, values); });
    for (auto const& [p, value] : model) ASSERT_EQ(field.get(p[0], p[1], p[2]), value) << threads;
    std::vector<int3> corners;
    for (int d = 0; d <= 28; ++d)
      for (std::int64_t n = 0; n < volume.tree().tileCount(d); ++n)
        corners.push_back(volume.tree().tile(n, d).tijk());
    if (threads == 1) order = corners;
    EXPECT_EQ(corners, order) << threads;
  }
}

TEST(VolumeTest, RequirementSamplesAreThoseOfTheSampler) {
  Volume volume(0.5f);
  auto field = volume.addField<float>("f", 7);
  for (int k = -6; k < 10; ++k)
    for (int j = -6; j < 10; ++j)
      for (int i = -6; i < 10; ++i) field.set(i, j, k, float(i + 2 * j + 3 * k));
  EXPECT_FLOAT_EQ(field.sample({0.75f, 0.25f, 1.0f}), 1.5f + 1.0f + 6.0f);
  EXPECT_FLOAT_EQ(field.sample({1.5f, 0.5f, 2.0f}, kSamplerTileSpace), 1.5f + 1.0f + 6.0f);
  std::vector<float3> const positions{{0.75f, 0.25f, 1.0f}, {0.25f, 0.25f, 0.5f}, {1e9f, 0, 0}};
  std::vector<float> values(positions.size());
  field.sample(positions, values);
  for (std::size_t n = 0; n < positions.size(); ++n) EXPECT_EQ(values[n], field.sample(positions[n])) << n;
  EXPECT_THROW(field.sample(positions, std::span(values).first(2)), std::invalid_argument);
  float3 const g = field.gradient({0.75f, 0.25f, 1.0f});
  EXPECT_FLOAT_EQ(g.x, 2.0f);
  EXPECT_FLOAT_EQ(g.y, 4.0f);
  EXPECT_FLOAT_EQ(g.z, 6.0f);
  // A write is seen by the next sample, also one through another handle, and one on a tile's edge.
  auto other = volume.field<float>("f");
  other.set(4, 0, 0, 100);
  EXPECT_FLOAT_EQ(field.sample({3.5f, 0, 0}, kSamplerTileSpace), 51.5f);
  other.set(4, 0, 0, 200);
  EXPECT_FLOAT_EQ(field.sample({3.5f, 0, 0}, kSamplerTileSpace), 101.5f);
  float const nan = std::numeric_limits<float>::quiet_NaN(), inf = std::numeric_limits<float>::infinity();
  for (float3 const& p : {float3{nan, 0, 0}, float3{0, inf, 0}, float3{0, 0, -inf}, float3{3e9f, 0, 0}}) {
    EXPECT_EQ(field.sample(p), 7.0f);
    EXPECT_EQ(field.gradient(p), (float3{0, 0, 0}));
  }
}

TEST(VolumeTest, RequirementStencilsSeeNeighborsAcrossTilesAndBeyondThem) {
  Volume volume;
  auto from = volume.addField<int>("from", -5);
  auto to = volume.addField<int>("to", 0);
  std::mt19937 random(3);
  for (int n = 0; n < 300; ++n)
    from.set(static_cast<int>(random() % 24) - 12, static_cast<int>(random() % 24) - 12,
             static_cast<int>(random() % 24) - 12, static_cast<int>(random() % 1000));
  forEachSample(from, to, [](Neighbors<int> const& n) {
    int sum = 0;
    for (int c = 0; c < 27; ++c) sum += (c * c + 1) * n(c % 3 - 1, c / 3 % 3 - 1, c / 9 - 1);
    return sum;
  });
  std::int64_t checked = 0;
  for (std::int64_t t = 0; t < volume.tree().tileCount(28); ++t) {
    int3 const corner = volume.tree().tile(t, 28).tijk();
    for (int e = 0; e < 64; ++e, ++checked) {
      int3 const p{corner.x + e % 4, corner.y + e / 4 % 4, corner.z + e / 16};
      int sum = 0;
      for (int c = 0; c < 27; ++c)
        sum += (c * c + 1) * from.get(p.x + c % 3 - 1, p.y + c / 3 % 3 - 1, p.z + c / 9 - 1);
      ASSERT_EQ(to.get(p), sum) << p;
    }
  }
  EXPECT_GT(checked, 10000);
  EXPECT_THROW(forEachSample(from, from, [](Neighbors<int> const&) { return 0; }), std::invalid_argument);
}

TEST(VolumeTest, RequirementRefineAndRemoveByPredicate) {
  Volume volume;
  auto field = volume.addField<float>("f", 0);
  auto const nearSphere = [](TileBox const& box) {
    double const h = 0.5 * box.width;
    double const r = std::hypot(box.corner.x + h, box.corner.y + h, box.corner.z + h);
    return std::abs(r - 40) < h * 1.8 + 1;
  };
  volume.refineWhere({-64, -64, -64}, {64, 64, 64}, nearSphere);
  std::int64_t expected = 0;
  for (int k = -64; k < 64; k += 4)
    for (int j = -64; j < 64; j += 4)
      for (int i = -64; i < 64; i += 4) expected += nearSphere({{i, j, k}, 4, 28});
  EXPECT_EQ(volume.tree().tileCount(28), expected);
  EXPECT_TRUE(volume.tree().checkConsistency(false));
  forEachSample(field, [](int3 const& p, float& value) { value = float(p.x); });
  std::int64_t const gone = volume.removeWhere([](TileBox const& box) { return box.corner.x < 0; });
  EXPECT_GT(gone, 0);
  EXPECT_EQ(volume.tree().tileCount(28), expected - gone);
  for (std::int64_t t = 0; t < volume.tree().tileCount(28); ++t)
    ASSERT_EQ(field.get(volume.tree().tile(t, 28).tijk()), float(volume.tree().tile(t, 28).ti()));
  EXPECT_EQ(field.get(-40, 0, 0), 0.0f);
  EXPECT_TRUE(volume.tree().checkConsistency(false));
  EXPECT_EQ(volume.removeWhere([](TileBox const&) { return false; }), 0);
}

TEST(VolumeTest, RequirementCoarseSamplesAndHalosFollowOnRequest) {
  Volume volume;
  auto field = volume.addField<float>("f", 0);
  EXPECT_THROW(field.halos(), std::logic_error);
  for (int i = 0; i < 8; ++i) field.set(i, 0, 0, float(i + 1));
  volume.fillCoarse();
  volume.removeWhere([](TileBox const& box) { return box.corner.x == 4; });
  EXPECT_EQ(field.get(4, 0, 0), 5.0f);
  EXPECT_EQ(field.get(5, 0, 0), 5.0f) << "of the coarser sample";
  EXPECT_EQ(field.get(6, 0, 0), 7.0f);
  field.set(4, 0, 0, 50);
  EXPECT_EQ(field.get(5, 0, 0), 5.0f) << "the new tile keeps what was read";
  volume.fillHalos("f");
  auto const at = volume.tree().tileAccessor().tile(0, 0, 0, 28, true).treeIndex();
  EXPECT_EQ(field.halos().tileData(at)(4, 0, 0), 50.0f);
  EXPECT_TRUE(volume.object().hasComponentFromName("f_halo"));
}

TEST(VolumeTest, RequirementPointsShareTheTreeAndFollowIt) {
  Volume volume(2.0f);
  auto field = volume.addField<float>("f", 0);
  std::vector<float3> positions;
  for (int n = 0; n < 500; ++n) positions.push_back({float(n) * 0.7f, -float(n), 3.0f});
  positions.push_back({std::numeric_limits<float>::quiet_NaN(), 0, 0});
  positions.push_back({1e30f, 0, 0});
  EXPECT_EQ(volume.addPoints("dust", positions), 500);
  EXPECT_THROW(volume.addPoints("dust", positions), std::invalid_argument);
  EXPECT_THROW(volume.points("f"), std::invalid_argument);
  auto const sorted = [](std::vector<float3> list) {
    std::sort(list.begin(), list.end(), [](float3 const& a, float3 const& b) { return a.y < b.y; });
    return list;
  };
  positions.resize(500);
  EXPECT_EQ(sorted(volume.points("dust")), sorted(positions));
  field.set(-300, 1, 1, 4);
  volume.removeWhere([](TileBox const& box) { return box.corner.x == -300; });
  EXPECT_EQ(sorted(volume.points("dust")), sorted(positions));
  EXPECT_EQ(volume.object().component<PointTopology<Volume::Shape>>("dust")->size(), 500u);
}

TEST(VolumeTest, RequirementThreadsReadAtOnceWithHandlesOfTheirOwn) {
  Volume volume;
  auto field = volume.addField<float>("f", 0), other = volume.addField<float>("g", 1);
  for (int n = 0; n < 4000; ++n) field.set(n % 50, n / 50 % 50, n % 13, float(n));
  // Nothing has asked for "g" since: the first readers bring it into step.
  std::atomic<int> wrong{0};
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t)
    threads.emplace_back([&] {
      auto const f = volume.field<float>("f"), g = volume.field<float>("g");
      Volume const copy = volume;
      for (int n = 0; n < 4000; ++n) {
        wrong += g.get(n % 50, n / 50 % 50, n % 13) != 1.0f;
        wrong += g.sample({float(n % 50), 0.5f, 0.5f}) != 1.0f;
        wrong +=
            f.get(n % 50, n / 50 % 50, n % 13) != copy.field<float>("f").get(n % 50, n / 50 % 50, n % 13);
      }
    });
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(wrong.load(), 0);
  EXPECT_EQ(other.channel().tileCount(-1), volume.tileCount());
}

} // namespace
} // namespace VLN::Test
