// What `render` draws: one grid of a file, ready for rays, or points.
#pragma once

#include "Interop/Flatten.h"
#include "Interop/NvttRead.h"
#include "Interop/VdbImport.h"
#include "Reader/NanoVTTReader.h"
#include "Render/Points.h"

#include <memory>
#include <optional>
#include <string>

namespace Vln {

struct RenderSource {
  std::optional<VLN::Render::PointCloud> points; ///< in place of a grid

  std::string channel;
  std::string gridClass; ///< "fog volume", "level set", or another or none
  nanovtt::GridReader grid;
  void const* bounds = nullptr; ///< of its tiles, where the file has them
  VLN::Render::Affine tileToWorld;
  std::string note; ///< what the user should know; empty for nothing

  std::unique_ptr<VLN::Interop::MappedNvtt> mapped; ///< of a .nvtt file
  VLN::Interop::FlatVolume flat;                    ///< of others
};

/// @param channel Empty: "density" or "surface" when there is one, else the first that has active voxels;
/// points where there is none.
/// @error FileError, when there is nothing to draw as well.
RenderSource renderSource(std::string const& file, std::string const& channel,
                          VLN::Interop::VdbReadLimits const& limits, VLN::Interop::Progress const& progress);

} // namespace Vln
