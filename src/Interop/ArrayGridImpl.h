// ArrayGrid: a grid that is made of the numbers of an array, as files of arrays bring them.
#pragma once

#include "Interop/FileError.h"

#include "Interop/VdbTypesImpl.h"

#include <cstddef>
#include <cstdint>
#include <memory>
#include <string>

namespace VLN::Interop {

/// Of a file whose name is added by who reads it.
struct UnreadableArrays : FileError {
  explicit UnreadableArrays(std::string const& reason)
      : FileError("", reason) {}
};

/// Indices of volumes lie closer to 0.
inline constexpr double kIndexReach = 0x1p29;
/// @error UnreadableArrays for an index, or the end of a box, that is not within reach.
inline void checkIndex(double index) {
  if (!(index > -kIndexReach && index < kIndexReach))
    throw UnreadableArrays("lies at indices that volumes do not have");
}

struct NumberType {
  char kind = 'f'; ///< f, i, u, or b for bytes that are true or false
  int bytes = 4;
  bool bigEndian = false;
};

/// Where the numbers of an array lie. Strides are in bytes.
struct ArrayLayout {
  std::int64_t count[3] = {0, 0, 0}; ///< along x, y and z
  std::int64_t stride[3] = {0, 0, 0};
  std::int64_t componentStride = 0;
};

class ArrayGrid {
public:
  /// For numbers of a type, of one or three components; half floats become floats, short integers int32, and
  /// uint32 int64. Null for what no volume has.
  static std::unique_ptr<ArrayGrid> of(NumberType const& type, int components);
  virtual ~ArrayGrid() = default;

  virtual openvdb::GridBase::Ptr grid() const = 0;
  /// Before any voxel. Components lie side by side. Types of numbers may be others than the grid is made for,
  /// here and below.
  virtual void setBackground(std::byte const* value, NumberType const& type) = 0;
  /// Voxels from `low` on; those that are not the background become active.
  virtual void setBox(std::byte const* values, NumberType const& type, ArrayLayout const& layout,
                      openvdb::Coord const& low) = 0;
  /// One active voxel.
  virtual void setVoxel(openvdb::Coord const& at, std::byte const* value, NumberType const& type,
                        std::int64_t componentStride) = 0;
};

/// Any number as a double or a 64-bit integer.
double realOf(std::byte const* bytes, NumberType const& type);
std::int64_t wholeOf(std::byte const* bytes, NumberType const& type);

/// From the rows of a matrix from indices to world space.
/// @error UnreadableArrays for one that cannot be turned round.
openvdb::math::Transform::Ptr transformOfRows(double const (&rows)[3][4]);

} // namespace VLN::Interop
