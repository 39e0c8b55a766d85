#include "GeometryVolume/sampling/VoxelSampler.h"

namespace VLN::TileTree3D {

template <class TraitsT, class Real, class Position>
VoxelSampler<TraitsT, Real, Position>::~VoxelSampler() = default;

template <class TraitsT, class Real, class Position>
char const* VoxelSampler<TraitsT, Real, Position>::idString() const {
  return "kNone";
}

#define VLN_INSTANTIATE(TraitsT) template class VLN_API VoxelSampler<TraitsT, float, float3>;
VLN_FOR_EACH_SHAPE(VLN_INSTANTIATE)

} // namespace VLN::TileTree3D
