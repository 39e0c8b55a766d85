// The rounds of vln churn.
#pragma once

#include "vln/Commands.h"

#include <cstdint>

namespace Vln {

/// @units Bytes, seconds.
struct ChurnFigures {
  double seconds = 0;             ///< mean of a round
  std::uint64_t peakResident = 0; ///< of the process, reading the file left out where the system can tell
  std::int64_t voxels = 0;        ///< active voxels of the channels
  std::uint64_t heldByChannels = 0, heldByArrays = 0,
                heldByBlocks = 0; ///< by the pools, after the last round
  double checksum = 0;            ///< of all values; the same with pools and without
};

/// Reads the file once. Each round then loads its channels anew into a tree of their own, copies each into a
/// working channel whose layout changes from round to round, edits the copy, hands it over as a flat array,
/// and drops everything. With pools, the process's resident memory is limited; without, nothing holds it.
ChurnFigures runChurn(ChurnOptions const& options, bool pools);

} // namespace Vln
