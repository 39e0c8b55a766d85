// writeUsda(): a scene in USD's text format that shows the volumes of a .vdb file, which is written beside
// it.
//
//   smoke.usda     def Xform "smoke"                      metersPerUnit 1, upAxis "Y"
//                    def Volume "volume"                  one for each transform; its extent in the world
//                      rel field:density ...
//                      def OpenVDBAsset "density"         filePath ./smoke.vdb, fieldName, class and type
//   smoke.vdb      the grids, as exportVdb() writes them
#pragma once

#include "Interop/VdbImport.h"

#include <string>

namespace VLN::Interop {

/// Writes both files whole, or neither. Where the .vdb file beside it is the one that `content` comes from,
/// that is named as it stands and not written.
/// @error FileError.
VLN_API void writeUsda(std::string const& path, VdbImport const& content, Progress const& progress = {});

} // namespace VLN::Interop
