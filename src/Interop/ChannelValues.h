// ChannelValues: the values of a channel of any type, as numbers.
#pragma once

#include "GeometryVolume/core/Export.h"
#include "Interop/VdbImport.h"
#include "Velorn/Math.h"

#include <memory>
#include <string>

namespace VLN::Interop {

inline constexpr int kMostComponents = 4;

/// Length of a vector of one to four components.
VLN_API double lengthOf(double const* components, int count);

/// @space Tile space. Sample (i, j, k) of the deepest tiles lies at that index, where the file has its voxel.
/// @threads One copy for each thread.
class VLN_API ChannelValues {
public:
  /// Of the types that files have; null for others, and where there is no such channel. Refers to the volume.
  static std::unique_ptr<ChannelValues> of(VdbVolume const& volume, std::string const& channel);
  virtual ~ChannelValues();
  virtual std::unique_ptr<ChannelValues> clone() const = 0;

  virtual int components() const = 0;
  /// Whether values are integers, such as counts and labels: a blend of two would mean nothing.
  virtual bool whole() const = 0;
  /// Whether values are doubles.
  virtual bool wide() const = 0;
  /// The value at a voxel, as the file has it.
  virtual void at(Velorn::Math::int3 const& voxel, double* values) const = 0;
  /// The same as text, exactly, components between commas.
  virtual std::string text(Velorn::Math::int3 const& voxel) const = 0;

  /// The voxel that a position lies nearest to.
  static Velorn::Math::int3 nearest(Velorn::Math::double3 const& position);
  /// Blended between the eight voxels around a position; integers of the nearest one.
  void linear(Velorn::Math::double3 const& position, double* values) const;

protected:
  ChannelValues() = default;
};

} // namespace VLN::Interop
