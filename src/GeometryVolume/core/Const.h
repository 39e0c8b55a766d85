// Property keys under which the standard components of a volume live.
#pragma once

namespace VLN::Const {

inline constexpr char const* TileTreeChannelName = "tileTreeChannel";
inline constexpr char const* TileTreeContainerName = "tileTreeContainer";
inline constexpr char const* TileTreePointTopologyName = "tileTreePointTopo";
inline constexpr char const* TileTreeVoxelTopologyName = "tileTreeVoxelTopo";
inline constexpr char const* VoxelTopologyName = "voxelTopo";

} // namespace VLN::Const
