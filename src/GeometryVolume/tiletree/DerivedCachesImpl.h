// Builders of what a container derives from its tiles to speed lookups up. Each runs alone, with no change of
// the tree.
#pragma once

#include "GeometryVolume/tiletree/ContainerDataImpl.h"

namespace VLN::TileTree3D {

/// The grid, and the lookup table with it.
template <class TraitsT>
void buildAccelerationGrid(Container<TraitsT> const& tree, ContainerData<TraitsT>& data, int maxDepth);

/// The lookup table alone; null where no grid or no table fits.
template <class TraitsT>
std::shared_ptr<TileLookupTable<TraitsT> const> buildLookupTable(Container<TraitsT> const& tree);

template <class TraitsT>
std::shared_ptr<typename ContainerData<TraitsT>::NeighborTable const>
computeTileNeighbors(Container<TraitsT> const& tree);

template <class TraitsT>
std::shared_ptr<typename ContainerData<TraitsT>::HaloTable const>
computeTileHalos(Container<TraitsT> const& tree);

template <class TraitsT>
std::shared_ptr<CompressedHaloTable<TraitsT> const>
computeCompressedTileHalos(Container<TraitsT> const& tree);

template <class TraitsT> int maxTileDistance(Container<TraitsT> const& tree);

} // namespace VLN::TileTree3D
