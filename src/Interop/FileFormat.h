// FileFormat: which suffix stands for which format. A new format is a line in FileFormat.cpp.
#pragma once

#include "GeometryVolume/core/Export.h"

#include <initializer_list>
#include <string>

namespace VLN::Interop {

enum class FileFormat { kUnknown, kVdb, kNvtt, kPly, kObj, kPng, kCsv, kJson, kExr };

/// As the suffix of the name tells, whatever its case.
VLN_API FileFormat formatOf(std::string const& path);
/// ".vdb"; empty for kUnknown.
VLN_API char const* suffixOf(FileFormat format);

/// Tells whether a file of that name could be written in one of these formats, before the work that leads to
/// it. Pipes and devices, and with a single format names without a suffix, pass.
/// @param what Is written, for the message: "points".
/// @return The format.
/// @error FileError for a suffix that stands for no format of these, and as checkOutput().
VLN_API FileFormat checkOutputAs(std::string const& path, char const* what,
                                 std::initializer_list<FileFormat> formats);

} // namespace VLN::Interop
