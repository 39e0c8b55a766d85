// Linear samples of real grids, held against OpenVDB's own.
#include "GeometryVolume/channels/Halo.h"
#include "GeometryVolume/sampling/VoxelSamplerLinear.h"
#include "ImportCheck.h"
#include "support/RealVolumes.h"
#include "support/TempFolder.h"

#include <openvdb/tools/Interpolation.h>

#include <cmath>
#include <iostream>
#include <random>

namespace VLN::Test {
namespace {

using openvdb::Coord;
using WideChannel = TileTree3D::Channel<Shape, float, 5, 0>;
using Sampler = TileTree3D::FloatVoxelSamplerLinear<Shape>;
using Topology = TileTree3D::VoxelTopology<Shape>;

#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
constexpr int kPositions = 20000;
#else
constexpr int kPositions = 1000000;
#endif

// Where a position comes from.
enum Place { kActive, kBox, kTileSurface, kPlaces };
constexpr char const* kPlaceNames[] = {"in active cells", "anywhere in the box and a voxel beyond",
                                       "at the surfaces of leaves and tiles"};

// Boxes of active voxels, and of all leaves and tiles that are not background.
struct Parts {
  std::vector<Coord> active;
  std::vector<openvdb::CoordBBox> nodes;
  openvdb::CoordBBox box;
};
Parts partsOf(openvdb::FloatGrid const& grid, std::mt19937& random) {
  Parts parts;
  for (auto it = grid.cbeginValueAll(); it; ++it) {
    openvdb::CoordBBox box;
    it.getBoundingBox(box);
    if (it.isVoxelValue()) {
      if (it.isValueOn()) parts.active.push_back(it.getCoord());
      continue;
    }
    if (!it.isValueOn() && *it == grid.background()) continue;
    parts.nodes.push_back(box);
    parts.box.expand(box);
    if (!it.isValueOn()) continue;
    for (int n = 0; n < 64; ++n) {
      Coord c;
      for (int a = 0; a < 3; ++a)
        c[a] = box.min()[a] + static_cast<int>(random() % static_cast<unsigned>(box.dim()[a]));
      parts.active.push_back(c);
    }
  }
  for (auto leaf = grid.tree().cbeginLeaf(); leaf; ++leaf) {
    parts.nodes.push_back(leaf->getNodeBoundingBox());
    parts.box.expand(parts.nodes.back());
  }
  return parts;
}

struct Difference {
  std::int64_t compared = 0;
  double largest = 0;
  openvdb::Vec3d at;

  void add(float got, float expected, openvdb::Vec3d const& p) {
    ++compared;
    if (!std::isfinite(expected)) return;
    double const difference = std::abs(double(got) - double(expected));
    if (!(difference <= largest)) largest = difference, at = p;
  }
};

struct Differences {
  Difference places[kPlaces];
  std::int64_t cachedDiffers = 0;
  double range = 0;
};

openvdb::Vec3d positionIn(Place place, Parts const& parts, std::mt19937& random) {
  std::uniform_real_distribution<float> inside(0.0f, 1.0f);
  openvdb::Vec3d p;
  if (place == kActive) {
    Coord const c = parts.active[random() % parts.active.size()];
    for (int a = 0; a < 3; ++a) p[a] = double(float(c[a]) + inside(random));
    return p;
  }
  bool const whole = place == kBox;
  auto const& box = whole ? parts.box : parts.nodes[random() % parts.nodes.size()];
  for (int a = 0; a < 3; ++a)
    p[a] = double(float(box.min()[a] - 1) + inside(random) * float(box.dim()[a] + 2));
  // One axis goes to a side of the node: within two voxels of it.
  if (!whole) {
    int const a = static_cast<int>(random() % 3);
    int const side = random() % 2 ? box.min()[a] : box.max()[a];
    p[a] = double(float(side) - 1.5f + 3.0f * inside(random));
  }
  return p;
}

Differences compare(openvdb::FloatGrid const& grid, Sampler const& wide, Sampler const& core, int positions) {
  auto values = grid.getConstAccessor();
  std::mt19937 random(20240);
  Parts const parts = partsOf(grid, random);
  Differences d;
  float low = grid.background(), high = low;
  for (auto it = grid.cbeginValueAll(); it; ++it)
    if (std::isfinite(*it)) low = std::min(low, *it), high = std::max(high, *it);
  d.range = double(high) - double(low);
  for (int place = kActive; place < kPlaces; ++place) {
    if (place == kActive ? parts.active.empty() : parts.nodes.empty()) continue;
    for (int n = 0; n < positions; ++n) {
      openvdb::Vec3d const q = positionIn(static_cast<Place>(place), parts, random);
      Velorn::Math::float3 const p{float(q.x()), float(q.y()), float(q.z())};
      float expected = 0;
      openvdb::tools::BoxSampler::sample(values, q, expected);
      float const got = wide.sample(p, TileTree3D::kSamplerTileSpace);
      float const cached = core.sample(p, TileTree3D::kSamplerTileSpace);
      d.cachedDiffers += !sameBits(got, cached);
      d.places[place].add(got, expected, q);
    }
  }
  return d;
}

void expectSampledAlike(Interop::VdbFile const& file, std::string const& title, int positions) {
  auto const content = Interop::importGrids(file);
  for (auto const& volume : content.volumes) {
    auto const tree = volume.object->component<Tree>(Interop::kVdbContainerName);
    auto const topology = volume.object->component<Topology>(Interop::kVdbTopologyName);
    for (auto const& info : volume.channels) {
      openvdb::FloatGrid::ConstPtr grid;
      for (std::size_t n = 0; n < file.grids.size(); ++n)
        if (file.grids[n]->getName() == info.gridName && file.grids[n]->isType<openvdb::FloatGrid>())
          grid = floatGrid(file, n);
      if (!grid) continue; // sampling is for float channels
      auto const core = volume.object->component<FloatChannel>(info.name);
      float const background = core->defaultValue();
      WideChannel wide("", &background, TileTree3D::kInitializeDefaultValue, false, true, core->minDepth(),
                       core->depth());
      wide.update(*topology);
      TileTree3D::computeHalo<Shape, float, 0, 0, 1, 0>(*core, *tree, wide, -1, -1);
      Differences const d = compare(*grid, {*tree, *topology, wide}, {*tree, *topology, *core}, positions);
      std::cout << title << " " << info.name << ": range " << d.range << ", " << tree->tileCount(-1)
                << " tiles";
      for (int place = kActive; place < kPlaces; ++place) {
        Difference const& here = d.places[place];
        std::cout << "; " << here.compared << " " << kPlaceNames[place] << ", largest difference "
                  << here.largest;
        EXPECT_LE(here.largest, 1e-5 * d.range)
            << info.name << " " << kPlaceNames[place] << " at " << here.at;
      }
      std::cout << "\n";
      EXPECT_EQ(d.cachedDiffers, 0) << info.name;
    }
  }
}

class SamplerDifference : public testing::TestWithParam<char const*> {};

// requirement: linear samples of a file are those of the file everywhere in its box and a voxel beyond, in
// leaves, in tiles, and beside both.
TEST_P(SamplerDifference, AgreesWithBoxSampler) {
  std::string const path = dataFile(std::string("vdb/") + GetParam());
  if (path.empty()) GTEST_SKIP() << "no shared test data";
  expectSampledAlike(Interop::readVdbFile(path), GetParam(), kPositions);
}

// requirement: the same for solids of tiles of each width, in fogs and level sets, alone and beside voxels.
openvdb::FloatGrid::Ptr solid(std::string const& name, float background) {
  auto grid = openvdb::FloatGrid::create(background);
  grid->setName(name);
  return grid;
}
TEST(SamplerDifferenceSolids, AgreeWithBoxSampler) {
  openvdb::initialize();
  Interop::VdbFile file;
  file.path = "solids";
  auto const add = [&](openvdb::FloatGrid::Ptr const& grid, int n) {
    // Apart, each with a tree of its own.
    grid->setTransform(openvdb::math::Transform::createLinearTransform(1.0 + n));
    file.grids.push_back(grid);
  };
  int n = 0;
  auto const fog = solid("fog of 8-wide tiles", 0.0f);
  fog->sparseFill(openvdb::CoordBBox({0, 0, 0}, {15, 15, 15}), 3.25f);
  add(fog, n++);
  auto const odd = solid("fog that is not aligned", 0.5f);
  odd->sparseFill(openvdb::CoordBBox({-13, 5, -150}, {150, 70, 9}), -2.0f);
  odd->sparseFill(openvdb::CoordBBox({20, 20, 20}, {45, 41, 47}), 4.0f);
  odd->tree().setValueOn({60, 60, 60}, 1.0f);
  add(odd, n++);
  auto const wide = solid("tiles of 128", 0.0f);
  wide->tree().addTile(2, {0, 0, 0}, 1.5f, true);
  wide->tree().addTile(2, {128, 0, 0}, 1.5f, true);
  wide->tree().addTile(1, {256, 64, 64}, 2.5f, true);
  wide->tree().addTile(1, {-8, 0, 0}, 0.25f, false);
  add(wide, n++);
  auto const inside = solid("inactive inside", 3.0f);
  for (int i = 0; i < 4; ++i)
    for (int j = 0; j < 4; ++j)
      for (int k = 0; k < 4; ++k) inside->tree().addTile(1, {8 * i, 8 * j, 8 * k}, -3.0f, false);
  inside->tree().setValueOn({40, 3, 3}, 0.1f);
  add(inside, n++);
  auto const zero = solid("negative zero", 1.0f);
  zero->tree().addTile(1, {0, 0, 0}, -0.0f, false);
  zero->tree().setValueOn({30, 3, 3}, 0.5f);
  add(zero, n++);
  expectSampledAlike(file, "generated", 20000);
}

// boundary: a tile of the widest kind, whose shell is millions of voxels.
TEST(SamplerDifferenceSolids, AgreeAtTheWidestTiles) {
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
  GTEST_SKIP() << "takes gigabytes under a sanitizer";
#endif
  openvdb::initialize();
  Interop::VdbFile file;
  file.path = "widest";
  auto const grid = solid("widest", 0.0f);
  grid->tree().addTile(3, {0, 0, 0}, 2.0f, true);
  file.grids.push_back(grid);
  expectSampledAlike(file, "generated", 20000);
}

INSTANTIATE_TEST_SUITE_P(Shared, SamplerDifference, realVolumes(), volumeName);

} // namespace
} // namespace VLN::Test
