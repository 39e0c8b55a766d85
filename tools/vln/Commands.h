// The sub-commands of vln. Each throws std::exception with a message for one line when it fails.
#pragma once

#include "Interop/Flatten.h"
#include "Interop/Slice.h"
#include "Interop/VdbFile.h"

#include <cstdint>
#include <string>
#include <vector>

namespace Vln {

struct InfoOptions {
  std::vector<std::string> files; ///< and patterns
  bool brief = false;             ///< a line for each
  bool json = false;
  bool memory = false;
  VLN::Interop::VdbReadLimits limits;
};
void info(InfoOptions const& options);

struct SliceOptions {
  std::string file;
  std::string channel;
  std::string output;
  VLN::Interop::SliceOptions plane;
  bool title = true;
  VLN::Interop::VdbReadLimits limits;
};
void slice(SliceOptions const& options);

struct ConvertOptions {
  std::string file;
  std::string output;
  bool strict = false; ///< what would be left out is an error
  VLN::Interop::VdbReadLimits limits;
  double voxelSize = 0, band = 3; ///< of what a mesh becomes
  double iso = 0, adaptivity = 0; ///< of the surface that a .ply file gets
  bool sparse = false;            ///< of .npz files: voxel by voxel
};
void convert(ConvertOptions const& options);

struct FlattenOptions {
  std::string file;
  std::string output;
  VLN::Interop::FlattenOptions flat;
  int boundsBits = 16; ///< of the bounds of tiles beside the buffer; 0 for none
  VLN::Interop::VdbReadLimits limits;
};
void flatten(FlattenOptions const& options);

struct ValidateOptions {
  std::string file;
};
void validate(ValidateOptions const& options);

struct ProbeOptions {
  std::string file;
  std::string channel;
  std::vector<std::string> positions; ///< x, y, z, x, y, z, ..., or "-"
  std::string points;                 ///< a CSV file, or "-" for standard input; empty for none
  std::string output;                 ///< empty for standard output
  VLN::Interop::VdbReadLimits limits;
};
void probe(ProbeOptions const& options);

struct MakeOptions {
  std::string shape;
  std::string output;
  std::int64_t voxels = 1000000;
};
void make(MakeOptions const& options);

struct ChurnOptions {
  std::string file;
  std::uint64_t limitBytes = 0;
  int rounds = 20;
  bool json = false;
  std::string only; ///< "with" or "without": one of the two runs, for the program itself
  VLN::Interop::VdbReadLimits limits;
};
void churn(ChurnOptions const& options);

/// Why the program fails has been said already.
struct AlreadyTold {};

/// How the points of a file become a volume.
struct PointsInput {
  std::string file; ///< .ply, or .vdb with a points grid
  std::string grid; ///< of a .vdb file; empty: its only points grid
  double voxelSize = 0;
  double pointsPerTile = 64;
  VLN::Interop::VdbReadLimits limits;
};
struct PointsOptions {
  PointsInput input;
  std::string output; ///< .obj, .ply or .vdb
  double size = 0;    ///< half-width of a cube in an .obj file; 0: a quarter of a voxel
};
void points(PointsOptions const& options);

struct TilesOptions {
  PointsInput input;
  int depth = 28;
  std::string output;
};
void tiles(TilesOptions const& options);

struct AdvectOptions {
  PointsInput input;
  std::vector<double> velocity;
  int steps = 1;
  bool json = false;
  std::string output;
};
void advect(AdvectOptions const& options);

/// Whether `info` has points to tell of: a .ply file.
bool isPointsFile(std::string const& path);

} // namespace Vln
