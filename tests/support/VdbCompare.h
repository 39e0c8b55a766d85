// Compares two OpenVDB grids by OpenVDB alone: what differs, in words; empty when nothing does.
#pragma once

#include "Interop/VdbTypesImpl.h"

#include <cstring>
#include <sstream>
#include <string>

namespace VdbCompare {

template <class V> bool sameBits(V const& a, V const& b) { return std::memcmp(&a, &b, sizeof(V)) == 0; }

inline std::string written(openvdb::math::Transform const& transform) {
  std::ostringstream out(std::ios::binary);
  transform.write(out);
  return out.str();
}

/// Metadata that a writer of files makes itself.
inline bool isFileStatistic(std::string const& key) { return key.rfind("file_", 0) == 0; }

inline std::string metadataDifference(openvdb::MetaMap const& a, openvdb::MetaMap const& b) {
  auto const missing = [](openvdb::MetaMap const& from, openvdb::MetaMap const& in) -> std::string {
    for (auto it = from.beginMeta(); it != from.endMeta(); ++it) {
      if (isFileStatistic(it->first)) continue;
      auto const other = in[it->first];
      if (!other || !(*other == *it->second)) return "metadata '" + it->first + "' differs";
    }
    return "";
  };
  std::string const difference = missing(a, b);
  return difference.empty() ? missing(b, a) : difference;
}

template <class GridT> std::string valueDifference(GridT const& a, GridT const& b) {
  using Value = typename GridT::ValueType;
  std::ostringstream out;
  auto const in = b.getConstAccessor();
  // Every active value of a, voxel or tile, is one of b at the same level, with the same bits.
  for (auto it = a.cbeginValueOn(); it; ++it) {
    openvdb::Coord const c = it.getCoord();
    int const depth = it.isVoxelValue() ? 3 : int(it.getDepth());
    if (!in.isValueOn(c) || in.getValueDepth(c) != depth || !sameBits(Value(in.getValue(c)), Value(*it))) {
      out << "active value at " << c << " of depth " << depth << " differs: " << *it << " and "
          << in.getValue(c) << ", on " << in.isValueOn(c) << ", depth " << in.getValueDepth(c);
      return out.str();
    }
  }
  // Inactive values too, wherever a stores one.
  for (auto it = a.cbeginValueOff(); it; ++it) {
    openvdb::CoordBBox const box = it.getBoundingBox();
    for (openvdb::Coord const& c :
         {box.min(), box.max(),
          openvdb::Coord((box.min().x() + box.max().x()) / 2, box.min().y(), box.max().z())})
      if (in.isValueOn(c) || !sameBits(Value(in.getValue(c)), Value(*it))) {
        out << "inactive value at " << c << " differs: " << *it << " and " << in.getValue(c);
        return out.str();
      }
  }
  return "";
}

template <class GridT> std::string typedDifference(openvdb::GridBase const& a, openvdb::GridBase const& b) {
  auto const& x = static_cast<GridT const&>(a);
  auto const& y = static_cast<GridT const&>(b);
  if (!sameBits(typename GridT::ValueType(x.background()), typename GridT::ValueType(y.background())))
    return "backgrounds differ";
  std::string const difference = valueDifference(x, y);
  return difference.empty() ? valueDifference(y, x) : difference;
}

inline std::string difference(openvdb::GridBase const& a, openvdb::GridBase const& b) {
  if (a.type() != b.type()) return "types differ: " + a.type() + " and " + b.type();
  if (a.getName() != b.getName()) return "names differ: " + a.getName() + " and " + b.getName();
  if (a.getGridClass() != b.getGridClass()) return "classes differ";
  if (a.saveFloatAsHalf() != b.saveFloatAsHalf()) return "half storage differs";
  // Not by the comparison of transforms, which lets small differences pass.
  if (written(a.transform()) != written(b.transform())) return "transforms differ";
  if (a.activeVoxelCount() != b.activeVoxelCount()) return "counts of active voxels differ";
  std::string const metadata = metadataDifference(a, b);
  if (!metadata.empty()) return metadata;
#define VLN_COMPARE(GridT)                                                                                   \
  if (a.isType<openvdb::GridT>()) return typedDifference<openvdb::GridT>(a, b);
  VLN_COMPARE(FloatGrid)
  VLN_COMPARE(DoubleGrid)
  VLN_COMPARE(Int32Grid)
  VLN_COMPARE(Int64Grid)
  VLN_COMPARE(BoolGrid)
  VLN_COMPARE(Vec3SGrid)
  VLN_COMPARE(Vec3DGrid)
  VLN_COMPARE(Vec3IGrid)
#undef VLN_COMPARE
  return "a type that is not compared: " + a.type();
}

} // namespace VdbCompare
