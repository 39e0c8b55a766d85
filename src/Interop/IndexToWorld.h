// IndexToWorld: the transform of a file's grids, kept whole.
#pragma once

#include "GeometryVolume/core/Export.h"
#include "Velorn/Math.h"

#include <memory>
#include <string>

namespace VLN::Interop {

/// Index space is the tree's tile space. Any transform that OpenVDB knows: scales, rotations, translations,
/// frusta.
/// @threads Reading is safe from any thread.
class VLN_API IndexToWorld {
public:
  /// The identity.
  IndexToWorld();
  /// From OpenVDB's own bytes.
  /// @error std::runtime_error when they are none.
  explicit IndexToWorld(std::string const& bytes);
  /// World = origin + scale * index.
  IndexToWorld(double scale, Velorn::Math::double3 const& origin);

  Velorn::Math::double3 toWorld(Velorn::Math::double3 const& index) const;
  Velorn::Math::double3 toIndex(Velorn::Math::double3 const& world) const;
  /// The gradient in world space of a field whose gradient in index space is known at a point.
  /// @formula The transposed inverse of the transform's derivative at `index`, times `gradient`.
  Velorn::Math::double3 gradientToWorld(Velorn::Math::double3 const& gradient,
                                        Velorn::Math::double3 const& index) const;
  /// World lengths of a voxel's edges, for a transform that is not linear those at the origin.
  Velorn::Math::double3 voxelSize() const;
  /// Empty for one uniform scale along the axes; otherwise what the transform is, on one line.
  std::string besidesScale() const;
  std::string bytes() const;

  struct Impl;
  Impl const& impl() const { return *m_impl; }

private:
  std::shared_ptr<Impl const> m_impl;
};

} // namespace VLN::Interop
