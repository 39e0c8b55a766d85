// The sub-commands of vln. Each throws std::exception with a message for one line when it fails.
#pragma once

#include "Interop/Slice.h"
#include "Interop/VdbFile.h"

#include <cstdint>
#include <string>
#include <vector>

namespace Vln {

struct InfoOptions {
  std::string file;
  bool json = false;
  VLN::Interop::VdbReadLimits limits;
};
void info(InfoOptions const& options);

struct SliceOptions {
  std::string file;
  std::string channel;
  std::string output;
  VLN::Interop::SliceOptions plane;
  VLN::Interop::VdbReadLimits limits;
};
void slice(SliceOptions const& options);

struct ProbeOptions {
  std::string file;
  std::string channel;
  std::vector<float> positions; ///< x, y, z, x, y, z, ...
  std::string points;           ///< a CSV file; empty for none
  VLN::Interop::VdbReadLimits limits;
};
void probe(ProbeOptions const& options);

struct MakeOptions {
  std::string shape;
  std::string output;
  std::int64_t voxels = 1000000;
};
void make(MakeOptions const& options);

} // namespace Vln
