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

// Active voxels to start positions from: of leaves all, of active tiles a spread.
std::vector<Coord> someActive(openvdb::FloatGrid const& grid, std::mt19937& random) {
  std::vector<Coord> voxels;
  for (auto it = grid.cbeginValueOn(); it; ++it) {
    openvdb::CoordBBox box;
    it.getBoundingBox(box);
    if (it.isVoxelValue()) {
      voxels.push_back(it.getCoord());
      continue;
    }
    for (int n = 0; n < 64; ++n) {
      Coord c;
      for (int a = 0; a < 3; ++a)
        c[a] = box.min()[a] + static_cast<int>(random() % static_cast<unsigned>(box.dim()[a]));
      voxels.push_back(c);
    }
  }
  return voxels;
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
  Difference voxels; ///< all eight are voxels of leaves
  Difference tiles;  ///< some lie in active tiles
  std::int64_t cachedDiffers = 0;
  double range = 0;
};

enum class Stencil { kInactive, kVoxels, kTiles };
Stencil stencilAt(openvdb::FloatGrid::ConstAccessor& grid, Coord const& c) {
  Stencil result = Stencil::kVoxels;
  for (int n = 0; n < 8; ++n) {
    Coord const v = c.offsetBy(n & 1, n >> 1 & 1, n >> 2);
    if (!grid.isValueOn(v)) return Stencil::kInactive;
    if (!grid.isVoxel(v)) result = Stencil::kTiles;
  }
  return result;
}

Differences compare(openvdb::FloatGrid const& grid, Sampler const& wide, Sampler const& core) {
  auto values = grid.getConstAccessor();
  std::mt19937 random(20240);
  std::uniform_real_distribution<float> inside(0.0f, 1.0f);
  auto const voxels = someActive(grid, random);
  Differences d;
  float low = std::numeric_limits<float>::max(), high = -low;
  for (auto it = grid.cbeginValueOn(); it; ++it)
    if (std::isfinite(*it)) low = std::min(low, *it), high = std::max(high, *it);
  if (low <= high) d.range = double(high) - double(low);
  std::int64_t compared = 0;
  for (int attempt = 0; attempt < 20 * kPositions && compared < kPositions && !voxels.empty(); ++attempt) {
    Coord const c = voxels[random() % voxels.size()];
    Velorn::Math::float3 const p{float(c.x()) + inside(random), float(c.y()) + inside(random),
                                 float(c.z()) + inside(random)};
    openvdb::Vec3d const q(double(p.x), double(p.y), double(p.z));
    Stencil const stencil = stencilAt(values, Coord::floor(q));
    if (stencil == Stencil::kInactive) continue;
    ++compared;
    float expected = 0;
    openvdb::tools::BoxSampler::sample(values, q, expected);
    float const got = wide.sample(p, TileTree3D::kSamplerTileSpace);
    float const cached = core.sample(p, TileTree3D::kSamplerTileSpace);
    d.cachedDiffers += !sameBits(got, cached);
    (stencil == Stencil::kVoxels ? d.voxels : d.tiles).add(got, expected, q);
  }
  return d;
}

class SamplerDifference : public testing::TestWithParam<char const*> {};

// requirement: where all eight voxels are active and stored, the two agree. An active tile is constant for
// OpenVDB, and one wide sample here, from which the field goes over to the next: beside such a tile, and in
// it, they agree where its neighbours hold the same value.
TEST_P(SamplerDifference, AgreesWithBoxSampler) {
  std::string const path = dataFile(std::string("vdb/") + GetParam());
  if (path.empty()) GTEST_SKIP() << "no shared test data";
  auto const file = Interop::readVdbFile(path);
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
      Differences const d = compare(*grid, {*tree, *topology, wide}, {*tree, *topology, *core});
      std::cout << GetParam() << " " << info.name << ": range " << d.range << "; " << d.voxels.compared
                << " positions between voxels, largest difference " << d.voxels.largest << "; "
                << d.tiles.compared << " touching active tiles, " << d.tiles.largest << "\n";
      EXPECT_LE(d.voxels.largest, 1e-5 * d.range) << "at " << d.voxels.at;
      EXPECT_EQ(d.cachedDiffers, 0);
      if (info.activeVoxels > 1000) { EXPECT_EQ(d.voxels.compared + d.tiles.compared, kPositions); }
    }
  }
}

INSTANTIATE_TEST_SUITE_P(Shared, SamplerDifference, realVolumes(), volumeName);

} // namespace
} // namespace VLN::Test
