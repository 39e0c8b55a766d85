// Branch sizes and the self-checks of a tree.
#pragma once

#include "GeometryVolume/tiletree/Container.h"

namespace VLN::TileTree3D {

/// Sets each tile's branch size to its own voxels plus the branches of its children. Needs a bottom-up order
/// with a barrier after each depth.
template <class TraitsT> bool checkBranchSizes(Container<TraitsT> const& tree, bool verbose);
template <class TraitsT> bool checkConsistency(Container<TraitsT> const& tree, bool verbose);

} // namespace VLN::TileTree3D
