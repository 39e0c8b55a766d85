// What a .vdb file says of its grids beside their values, out of what a volume keeps of it.
#pragma once

#include "Interop/VdbImport.h"

#include <string>
#include <vector>

namespace VLN::Interop {

struct VdbMetadatum {
  std::string name;
  std::string value; ///< as text
};

struct VdbGridDetails {
  std::string gridClass;              ///< "fog volume", "level set", "staggered", or "unknown"
  std::string background;             ///< exactly, components between commas
  std::string compression;            ///< as the writer of the file told it; empty where it did not
  bool half = false;                  ///< whether the file stores 16-bit floats
  std::vector<VdbMetadatum> metadata; ///< what is not told above
};
/// One for each channel of the volume, in the same order; what only a .vdb file tells is empty for others.
VLN_API std::vector<VdbGridDetails> detailsOf(VdbVolume const& volume);

/// The metadata of the file itself.
VLN_API std::vector<VdbMetadatum> metadataOf(VdbImport const& content);

/// Four rows of four numbers, for column vectors: world = matrix * (index, 1). Empty for a transform that is
/// not linear.
VLN_API std::vector<std::vector<double>> matrixOf(IndexToWorld const& transform);

} // namespace VLN::Interop
