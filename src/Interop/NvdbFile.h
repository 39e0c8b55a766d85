// .nvdb files: the grids of NanoVDB, by way of its own headers and OpenVDB.
#pragma once

#include "Interop/VdbImport.h"

#include <string>

namespace VLN::Interop {

/// Whether a file begins as .nvdb files do.
VLN_API bool isNvdbFile(std::string const& path);

/// Reads all grids and builds volumes of them as importVdb() does: float, double, int32, int64, bool, masks
/// and vectors of three floats or doubles; codes (Fp4, Fp8, Fp16, FpN) become floats. Others are named as
/// skipped. Data may be packed with zip or blosc. The file is read in a child process first, and every offset
/// in it is checked.
/// @error FileError.
VLN_API VdbImport importNvdb(std::string const& path, VdbReadLimits const& limits = {},
                             Progress const& progress = {});

/// Writes all grids of volumes, not packed, so that the file can be used where it lies. Of metadata the name
/// and the class are kept.
/// @error FileError; also for a transform that is not linear, and for vectors of integers and of doubles,
/// which NanoVDB's writer does not take.
/// @cost Holds the bytes of the file in memory once.
VLN_API void exportNvdb(VdbImport const& content, std::string const& path, Progress const& progress = {});

} // namespace VLN::Interop
