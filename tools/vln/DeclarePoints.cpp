#include "Commands.h"
#include "Declare.h"

#include <CLI/CLI.hpp>

#include <memory>

namespace Vln {

using VLN::Interop::FileContent;

namespace {

void addPointsInput(CLI::App& self, PointsInput& o) {
  self.add_option("FILE", o.file, "A .ply file, or a .vdb file with points")->required();
  self.add_option("--grid", o.grid, "Points grid of a .vdb file that has more than one")->type_name("NAME");
  auto* size = finite(self.add_option("--voxel-size", o.voxelSize, "World length of a voxel, for .ply files"))
                   ->check(CLI::PositiveNumber)
                   ->type_name("W");
  finite(self.add_option("--points-per-tile", o.pointsPerTile,
                         "Choose the voxel size of a .ply file so that a tile holds about so many points"))
      ->check(CLI::Range(2.0, 1e9))
      ->capture_default_str()
      ->excludes(size)
      ->type_name("N");
  addMemoryLimit(self, o.limits);
}

} // namespace

void declarePoints(CLI::App& self) {
  auto const options = std::make_shared<PointsOptions>();
  auto& o = *options;
  addPointsInput(self, o.input);
  self.add_option("-o,--output", o.output, outputFile(FileContent::kPoints))->required()->type_name("OUT");
  finite(self.add_option("--size", o.size,
                         "Half-width of the cubes of an .obj file (default: a quarter of a voxel)"))
      ->check(CLI::PositiveNumber)
      ->type_name("W");
  self.callback([options] { points(*options); });
}

void declareTiles(CLI::App& self) {
  auto const options = std::make_shared<TilesOptions>();
  auto& o = *options;
  addPointsInput(self, o.input);
  self.add_option("--depth", o.depth, "Depth of the tiles, as info tells them")
      ->required()
      ->check(CLI::Range(0, 28))
      ->type_name("D");
  self.add_option("-o,--output", o.output, "The file to write; tile_tree.mtl goes beside it")
      ->required()
      ->type_name("OUT.obj");
  self.callback([options] { tiles(*options); });
}

void declareAdvect(CLI::App& self) {
  auto const options = std::make_shared<AdvectOptions>();
  auto& o = *options;
  addPointsInput(self, o.input);
  finite(self.add_option("--velocity", o.velocity, "World vector of a step"))
      ->required()
      ->expected(3)
      ->type_name("X Y Z");
  self.add_option("--steps", o.steps, "Number of steps")
      ->check(CLI::Range(0, 1000000))
      ->capture_default_str()
      ->type_name("N");
  self.add_option("-o,--output", o.output,
                  "Write the moved points: " + VLN::Interop::suffixesWritten(FileContent::kPoints))
      ->type_name("OUT");
  self.add_flag("--json", o.json, "One JSON object instead of text");
  self.callback([options] { advect(*options); });
}

} // namespace Vln
