// The sub-commands of vln. Each throws std::exception with a message for one line when it fails.
#pragma once

#include "Interop/Slice.h"
#include "Interop/VdbFile.h"

#include <cstdint>
#include <string>

namespace Vln {

struct InfoOptions {
  std::string file;
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
  VLN::Interop::VdbReadLimits limits;
};
void slice(SliceOptions const& options);

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

} // namespace Vln
