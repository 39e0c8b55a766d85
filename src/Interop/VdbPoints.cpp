#include "Interop/VdbPoints.h"

#include "Interop/FileError.h"
#include "Interop/OutputFile.h"
#include "Interop/VdbExportImpl.h"
#include "Interop/VdbFileImpl.h"
#include "Interop/VdbImportImpl.h"
#include "Interop/VdbWriteImpl.h"

#include <openvdb/points/PointAttribute.h>
#include <openvdb/points/PointConversion.h>
#include <openvdb/points/PointCount.h>

#include <limits>

namespace VLN::Interop {

namespace {

using openvdb::points::AttributeHandle;
using openvdb::points::PointDataGrid;
using Velorn::Math::double3;
using Velorn::Math::float3;
using Velorn::Math::int3;

/// Reads one attribute of a file's value type V into element type T.
template <class T, class V, class Convert>
PointAttribute readAttribute(PointDataGrid const& grid, std::string const& name, std::size_t index,
                             Convert const& convert) {
  PointAttribute result = makeAttribute<T>(name);
  for (auto leaf = grid.tree().cbeginLeaf(); leaf; ++leaf) {
    AttributeHandle<V> const handle(leaf->constAttributeArray(index));
    for (auto at = leaf->beginIndexOn(); at; ++at) result.append<T>(convert(handle.get(*at)));
  }
  return result;
}

bool appendAttribute(PointDataGrid const& grid, std::string const& name, std::size_t index,
                     std::string const& type, PointSet& points) {
  auto const add = [&]<class T, class V>(auto const& convert) {
    if (makeAttribute<T>("").type.empty()) return false; // not in this build
    points.attributes.push_back(readAttribute<T, V>(grid, name, index, convert));
    return true;
  };
  auto const same = [&]<class T>() { return add.template operator()<T, T>([](T v) { return v; }); };
  if (type == "float") return same.template operator()<float>();
  if (type == "double") return same.template operator()<double>();
  if (type == "int8")
    return add.template operator()<signed char, std::int8_t>([](std::int8_t v) { return v; });
  if (type == "int16") return same.template operator()<short>();
  if (type == "int32") return same.template operator()<int>();
  if (type == "int64") return same.template operator()<std::int64_t>();
  if (type == "bool")
    return add.template operator()<unsigned char, bool>([](bool v) { return static_cast<unsigned char>(v); });
  if (type == "vec3s")
    return add.template operator()<float3, openvdb::Vec3f>([](auto const& v) {
      return float3{v.x(), v.y(), v.z()};
    });
  if (type == "vec3d")
    return add.template operator()<double3, openvdb::Vec3d>([](auto const& v) {
      return double3{v.x(), v.y(), v.z()};
    });
  if (type == "vec3i")
    return add.template operator()<int3, openvdb::Vec3i>([](auto const& v) {
      return int3{v.x(), v.y(), v.z()};
    });
  return false;
}

// Beyond this a float's share of a voxel becomes coarse.
constexpr int kNearIndex = 1 << 14;

// A point of index space that is near all points of the grid: zero where that is.
openvdb::Vec3d middleOf(PointDataGrid const& grid) {
  openvdb::CoordBBox box;
  if (!grid.tree().evalLeafBoundingBox(box)) return openvdb::Vec3d(0);
  openvdb::Vec3d middle(0);
  for (int a = 0; a < 3; ++a)
    if (box.min()[a] < -kNearIndex || box.max()[a] > kNearIndex)
      middle[a] = std::round((double(box.min()[a]) + box.max()[a]) / 2);
  return middle;
}

PointVolume readGrid(PointDataGrid const& grid) {
  PointSet points;
  auto const& transform = grid.transform();
  double const size = transform.voxelSize().x();
  if (size > 0 && std::isfinite(size)) points.voxelSize = size;
  auto const middle = middleOf(grid);
  auto const origin = transform.indexToWorld(middle);
  points.origin = {origin.x(), origin.y(), origin.z()};
  // A float would lose what lies between the origin and the points.
  points.doublePositions = origin != openvdb::Vec3d(0);
  // What is more than a scale and a shift goes into the positions.
  bool const scaled = transformBesidesScale(transform).rfind("not ", 0) != 0;

  std::vector<std::string> skipped;
  if (auto const first = grid.tree().cbeginLeaf()) {
    auto const& descriptor = first->attributeSet().descriptor();
    std::size_t const position = descriptor.find("P");
    if (position == openvdb::points::AttributeSet::INVALID_POS)
      throw std::runtime_error("its points have no positions");
    for (auto leaf = first; leaf; ++leaf) {
      // Leaves are read by the first one's attributes.
      if (!(leaf->attributeSet().descriptor() == descriptor))
        throw std::runtime_error("its points have different attributes in different places");
      leaf->validateOffsets(); // which handles do not
      AttributeHandle<openvdb::Vec3f> const handle(leaf->constAttributeArray(position));
      for (auto at = leaf->beginIndexOn(); at; ++at) {
        auto p = openvdb::Vec3d(handle.get(*at)) + at.getCoord().asVec3d();
        p = scaled ? p - middle : (transform.indexToWorld(p) - origin) / points.voxelSize;
        points.positions.push_back(
            {static_cast<float>(p.x()), static_cast<float>(p.y()), static_cast<float>(p.z())});
      }
    }
    for (auto const& [name, index] : descriptor.map()) {
      if (name == "P" || descriptor.hasGroup(name)) continue;
      std::string const type = descriptor.valueType(index);
      bool const single = first->constAttributeArray(index).stride() == 1;
      bool const isGroup = openvdb::points::isGroup(first->constAttributeArray(index));
      if (!single || isGroup || !appendAttribute(grid, name, index, type, points))
        skipped.push_back(name + " (" + (isGroup ? "group" : type) + ")");
    }
  }
  PointVolume volume = buildPointVolume(points);
  volume.name = grid.getName();
  volume.skippedAttributes.insert(volume.skippedAttributes.end(), skipped.begin(), skipped.end());
  return volume;
}

/// The type that the format knows for an element type, wide enough to hold its values where there is one.
template <class T> struct Stored { using type = void; };
template <> struct Stored<signed char> { using type = std::int16_t; };
template <> struct Stored<unsigned char> { using type = std::int16_t; };
template <> struct Stored<short> { using type = std::int16_t; };
template <> struct Stored<unsigned short> { using type = std::int32_t; };
template <> struct Stored<int> { using type = std::int32_t; };
template <> struct Stored<unsigned int> { using type = std::int64_t; };
template <> struct Stored<std::int64_t> { using type = std::int64_t; };
template <> struct Stored<std::uint64_t> { using type = std::int64_t; };
template <> struct Stored<float> { using type = float; };
template <> struct Stored<double> { using type = double; };
template <> struct Stored<float3> { using type = openvdb::Vec3f; };
template <> struct Stored<double3> { using type = openvdb::Vec3d; };
template <> struct Stored<int3> { using type = openvdb::Vec3i; };

template <class T, class V> V toStored(T const& v) {
  if constexpr (requires { v.x; })
    return V(v.x, v.y, v.z);
  else
    return static_cast<V>(v);
}

} // namespace

std::vector<PointVolume> importVdbPoints(std::string const& path, VdbReadLimits const& limits,
                                         Progress const& progress) {
  if (progress) progress("reading", 0);
  VdbFile const file = readVdbFile(path, limits);
  if (progress) progress("building the tree", 0.5);
  std::vector<SkippedGrid> skipped;
  auto volumes = importPointGrids(file, skipped);
  if (!skipped.empty()) throw FileError(path, "'" + oneLine(skipped[0].grid, 60) + "': " + skipped[0].reason);
  return volumes;
}

bool isPointGrid(openvdb::GridBase const& grid) { return grid.isType<PointDataGrid>(); }

std::vector<PointVolume> importPointGrids(VdbFile const& file, std::vector<SkippedGrid>& skipped) {
  std::vector<PointVolume> volumes;
  for (auto const& base : file.grids) {
    auto const grid = openvdb::gridConstPtrCast<PointDataGrid>(base);
    if (!grid) continue;
    try {
      volumes.push_back(readGrid(*grid));
    } catch (std::bad_alloc const&) { throw; } catch (std::exception const& error) {
      skipped.push_back({grid->getName(), oneLine(error.what())});
    }
  }
  return volumes;
}

openvdb::GridBase::Ptr makePointsGrid(PointSet const& points, std::string const& name) {
  openvdb::initialize();
  auto transform = openvdb::math::Transform::createLinearTransform(points.voxelSize);
  transform->postTranslate({points.origin.x, points.origin.y, points.origin.z});
  std::vector<openvdb::Vec3d> world;
  world.reserve(points.size());
  for (std::size_t n = 0; n < points.size(); ++n) {
    double3 const p = points.world(n);
    world.emplace_back(p.x, p.y, p.z);
  }
  openvdb::points::PointAttributeVector<openvdb::Vec3d> const positions(world);
  auto const index =
      openvdb::tools::createPointIndexGrid<openvdb::tools::PointIndexGrid>(positions, *transform);
  auto grid = openvdb::points::createPointDataGrid<openvdb::points::NullCodec, PointDataGrid>(
      *index, positions, *transform);
  grid->setName(name);
  for (PointAttribute const& attribute : points.attributes) {
    withElementType(attribute.type, [&]<class T>() {
      using V = typename Stored<T>::type;
      if constexpr (!std::is_void_v<V>) {
        std::vector<V> values;
        values.reserve(points.size());
        for (std::size_t n = 0; n < points.size(); ++n)
          values.push_back(toStored<T, V>(attribute.value<T>(n)));
        using Array = openvdb::points::TypedAttributeArray<V>;
        openvdb::points::appendAttribute(grid->tree(), attribute.name, Array::attributeType());
        openvdb::points::PointAttributeVector<V> const wrapper(values);
        openvdb::points::populateAttribute(grid->tree(), index->tree(), attribute.name, wrapper);
      }
    });
  }
  return grid;
}

void writeVdbPoints(std::string const& path, PointSet const& points, std::string const& name) {
  OutputFile file(path);
  writeVdbFile(file, makePointsGrid(points, name));
}

} // namespace VLN::Interop
