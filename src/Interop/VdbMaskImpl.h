// Grids of masks travel as grids of bools whose active values are true.
#pragma once

#include "Interop/VdbTypesImpl.h"

#include <string>

namespace VLN::Interop {

/// Masks are told from bools by this, although their values are such.
inline constexpr char const* kMaskType = "mask";
std::string valueTypeOf(openvdb::GridBase const& grid);

/// The grid itself, or a grid of bools with name, transform and metadata of a mask grid.
openvdb::GridBase::Ptr withoutMask(openvdb::GridBase::Ptr const& grid);

/// The way back: a mask grid of the same active voxels and tiles.
openvdb::GridBase::Ptr maskOf(openvdb::GridBase const& bools);

} // namespace VLN::Interop
