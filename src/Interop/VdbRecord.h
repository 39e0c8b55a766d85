// What an object keeps of the file that it came from, as plain properties, so that it can be written back.
#pragma once

#include "Ostil/Array.h"
#include "Ostil/String.h"
#include "Velorn/Math.h"

namespace VLN::Interop {

/// How to tell which samples of a grid are active, but for those that VdbGridRecord::alsoActive lists.
enum class VdbActiveRule {
  kNotBackground, ///< those whose value is not the background, bit for bit
  kInsideBand,    ///< those nearer to zero than the background, as in a narrow band
  kChannel,       ///< a channel of bytes says it, see kVdbStateActive
};

/// Bits of a state channel's bytes. Samples of depths 25, 21 and 16 carry kVdbStateActive where the file has
/// an active tile exactly as wide as the sample.
inline constexpr unsigned char kVdbStateActive = 1; ///< active
inline constexpr unsigned char kVdbStateLeaf = 2;   ///< a voxel of one of the grid's own leaves

struct VdbGridRecord {
  Ostil::String channel;
  Ostil::String type; ///< as OpenVDB names the value type
  VdbActiveRule rule = VdbActiveRule::kNotBackground;
  Ostil::String stateChannel; ///< for kChannel
  Ostil::String metadata;     ///< OpenVDB's own bytes; name, class and half storage are part of it
  /// Voxels that are active although the rule takes their values for those of inactive ones.
  Ostil::Array<Velorn::Math::int3> alsoActive;
};

/// Key of an Ostil::Array<VdbGridRecord>, the grids in the order of the file.
inline constexpr char const* kVdbGridsProperty = "vdb_grids";
/// Key of an Ostil::String, OpenVDB's own bytes of the transform from index to world space.
inline constexpr char const* kVdbTransformProperty = "vdb_transform";
/// Key of an Ostil::String, OpenVDB's own bytes of the file's metadata.
inline constexpr char const* kVdbMetadataProperty = "vdb_metadata";

} // namespace VLN::Interop
