#pragma once

#include "Interop/Mesh.h"

namespace VLN::Interop {

/// The vertices and faces of a .ply file that is in memory.
/// @error FileError.
void parsePlyMesh(std::string const& path, char const* data, std::size_t size, Mesh& mesh);

} // namespace VLN::Interop
