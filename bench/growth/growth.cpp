// growth MILLIONS: how time and memory grow with a volume. Makes the level set of a sphere with about so many
// million active voxels, does one thing after the other with it, and prints a line of JSON for each:
//
//   {"step": "import", "voxels": 9995520, "seconds": 0.41, "bytes": 113000000}
//
// Bytes are what the process gained at most while it did it.
#include "BenchGrids.h"
#include "GeometryVolume/channels/Halo.h"
#include "GeometryVolume/sampling/VoxelSamplerLinear.h"
#include "Interop/VdbExport.h"

#include <algorithm>
#include <chrono>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <random>
#include <sstream>
#include <stdexcept>

#include <stdlib.h>

namespace {

using namespace VLN;
using namespace VLN::TileTree3D;
using Shape = PowerOfTwoTraits;
using Tree = Container<Shape>;
using Core = Channel<Shape, float, 4, 0>;
using Wide = Channel<Shape, float, 5, 0>;

double resident(char const* field) {
  std::ifstream in("/proc/self/status");
  for (std::string line; std::getline(in, line);)
    if (line.rfind(field, 0) == 0)
      return 1024 * std::strtod(line.c_str() + std::string(field).size() + 1, nullptr);
  return 0;
}

double activeVoxels = 0;

template <class Body> void step(char const* name, Body const& body) {
  std::ofstream("/proc/self/clear_refs") << 5; // the peak begins anew
  double const before = resident("VmRSS");
  auto const start = std::chrono::steady_clock::now();
  body();
  double const seconds = std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
  std::printf("{\"step\": \"%s\", \"voxels\": %.0f, \"seconds\": %.6g, \"bytes\": %.0f}\n", name,
              activeVoxels, seconds, std::max(0.0, resident("VmHWM") - before));
  std::fflush(stdout);
}

void run(double millions) {
  openvdb::initialize();
  // A shell of 4 pi r^2 and three voxels to either side.
  double const radius = std::sqrt(millions * 1e6 / (24 * 3.14159265358979));
  auto grid = openvdb::tools::createLevelSetSphere<openvdb::FloatGrid>(static_cast<float>(radius),
                                                                       openvdb::Vec3f(0), 1.0f, 3.0f);
  grid->setName("sphere");
  activeVoxels = static_cast<double>(grid->activeVoxelCount());

  Interop::VdbImport content;
  step("import", [&] { content = Bench::importGrid(grid); });
  grid.reset();
  auto const& volume = content.volumes.at(0);
  auto const tree = volume.object->component<Tree>(Interop::kVdbContainerName);
  auto const topology = volume.object->component<VoxelTopology<Shape>>(Interop::kVdbTopologyName);
  auto const core = volume.object->component<Core>(volume.channels.at(0).name);

  std::string folder = (std::filesystem::temp_directory_path() / "vln_growth_XXXXXX").string();
  if (!mkdtemp(folder.data())) throw std::runtime_error("no folder for a file");
  step("write .vdb", [&] { Interop::exportVdb(content, folder + "/sphere.vdb"); });
  std::filesystem::remove_all(folder);
  {
    float const background = core->defaultValue();
    Wide wide("", &background, kInitializeDefaultValue, true, true, core->minDepth(), core->depth());
    wide.update(*topology);
    // Where the one block for all tiles is not to be had, a channel stays as it was.
    if (wide.tileCount(-1) != tree->tileCount(-1)) throw std::runtime_error("no memory for wide tiles");
    step("halos", [&] { computeHalo<Shape, float, 0, 0, 1, 0>(*core, *tree, wide, -1, -1); });
    FloatVoxelSamplerLinear<Shape> const sampler(*tree, *topology, wide);
    std::mt19937 random(1);
    std::normal_distribution<float> normal;
    // As many samples as a tenth of the voxels, anywhere in the band.
    std::vector<float3> positions(static_cast<std::size_t>(activeVoxels / 10));
    for (float3& p : positions) {
      float3 const d{normal(random), normal(random), normal(random)};
      p = d * (static_cast<float>(radius) / std::sqrt(d.x * d.x + d.y * d.y + d.z * d.z));
    }
    std::vector<float> values(positions.size());
    step("sample at random",
         [&] { sampler.sample(positions.data(), values.data(), static_cast<std::int64_t>(values.size())); });
  }
  Tree other;
  step("refine", [&] { other.refine({tree.get()}, nullptr, true); });
  std::mt19937 random(2);
  std::vector<std::int64_t> third;
  for (std::int64_t n = 0; n < other.tileCount(Shape::kMaxDepth); ++n)
    if (random() % 3 == 0) third.push_back(n);
  step("remove a third", [&] { other.tileAccessor().removeTiles(third, Shape::kMaxDepth, true); });
}

} // namespace

int main(int argc, char** argv) {
  double const millions = argc == 2 ? std::strtod(argv[1], nullptr) : 0;
  if (!(millions > 0 && millions <= 1000)) {
    std::fprintf(stderr, "growth: tell the millions of voxels, up to 1000\n");
    return 2;
  }
  try {
    run(millions);
  } catch (std::exception const& e) {
    std::fprintf(stderr, "growth: %s\n", e.what());
    return 1;
  }
  return 0;
}
