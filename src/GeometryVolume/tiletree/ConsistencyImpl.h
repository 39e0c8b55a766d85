// The self-checks of a tree.
#pragma once

#include "GeometryVolume/tiletree/Container.h"

namespace VLN::TileTree3D {

/// See the operations of Container with these names.
template <class TraitsT> bool checkBranchSizes(Container<TraitsT> const& tree, bool verbose);
template <class TraitsT> bool checkConsistency(Container<TraitsT> const& tree, bool verbose);

} // namespace VLN::TileTree3D
