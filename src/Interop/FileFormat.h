// The formats of files: which suffix stands for which, and what may be read from it and written to it. A new
// format is a row of the table in FileFormat.cpp; help texts and messages follow from it.
#pragma once

#include "GeometryVolume/core/Export.h"

#include <string>

namespace VLN::Interop {

enum class FileFormat {
  kUnknown,
  kVdb,
  kNvtt,
  kPly,
  kObj,
  kPng,
  kCsv,
  kJson,
  kNpz,
  kVti,
  kExr,
  kVtkHdf,
  kNvdb,
  kUsda,
  kStl,
  kHtml,
  kZarr
};

/// What a file holds, as messages call it.
enum class FileContent : unsigned {
  kVolumes = 1,       ///< "volumes": trees with channels
  kGrids = 2,         ///< "grids": what is read and written again without loss
  kFlatBuffers = 4,   ///< "flat buffers"
  kPoints = 8,        ///< "points"
  kBoxes = 16,        ///< "boxes"
  kPictures = 32,     ///< "pictures"
  kValues = 64,       ///< "values": tables
  kDense = 128,       ///< "dense boxes": arrays of one depth
  kPointData = 256,   ///< "points" again, with all that they have
  kRenderings = 512,  ///< "pictures" with opacity and depth
  kParameters = 1024, ///< "parameters" of a picture
  kPages = 2048,      ///< "pages" for browsers
  kExports = 4096,    ///< "volumes" again, in any format that takes some of what they have
};
constexpr FileContent operator|(FileContent a, FileContent b) {
  return FileContent(unsigned(a) | unsigned(b));
}
constexpr bool operator&(FileContent a, FileContent b) { return (unsigned(a) & unsigned(b)) != 0; }

/// As the suffix of the name tells, whatever its case.
VLN_API FileFormat formatOf(std::string const& path);
/// ".vdb"; empty for kUnknown.
VLN_API char const* suffixOf(FileFormat format);

VLN_API bool isRead(FileFormat format, FileContent content);
VLN_API bool isWritten(FileFormat format, FileContent content);
/// ".obj, .ply or .vdb": the formats that such content, or any of several, is read from or written
/// to.
VLN_API std::string suffixesRead(FileContent content);
VLN_API std::string suffixesWritten(FileContent content);

/// Tells whether content could be written to a file of that name, before the work that leads to it. Pipes and
/// devices, and names without a suffix, pass where the content has a single format or a usual one.
/// @return The format.
/// @error FileError for a suffix that stands for no format of these, or of one that this build does not
/// write; and as checkOutput().
VLN_API FileFormat checkOutputFor(FileContent content, std::string const& path);

} // namespace VLN::Interop
