// Grids that show all that a .vdb file may hold, and files of them.
#pragma once

#include "Interop/VdbTypesImpl.h"

#include <cmath>
#include <functional>
#include <random>
#include <string>

namespace VLN::Test {

inline void write(std::string const& path, openvdb::GridPtrVec const& grids, std::uint32_t compression) {
  openvdb::io::File file(path);
  file.setCompression(compression);
  openvdb::MetaMap metadata;
  metadata.insertMeta("made by", openvdb::StringMetadata("a test"));
  metadata.insertMeta("flag", openvdb::BoolMetadata(true));
  metadata.insertMeta("place", openvdb::Vec3DMetadata(openvdb::Vec3d(1, 2, 3)));
  file.write(grids, metadata);
  file.close();
}

/// Voxels, tiles of three widths, some of them inactive, on both sides of the origin.
template <class GridT>
openvdb::GridBase::Ptr mixed(char const* name, std::function<typename GridT::ValueType(int)> value) {
  auto const grid = GridT::create(value(0));
  std::mt19937 random(5);
  auto const place = [&](int width) { return int(random() % (2 * unsigned(width))) - width; };
  for (int n = 0; n < 3000; ++n)
    grid->tree().setValueOn(openvdb::Coord(place(20), place(30), place(9)), value(int(random() % 100)));
  // Leaves with one and with two inactive values besides the background, and with many.
  for (int n = 0; n < 200; ++n) grid->tree().setValueOff(openvdb::Coord(40 + n % 8, n % 40, 0), value(7));
  for (int n = 0; n < 200; ++n)
    grid->tree().setValueOff(openvdb::Coord(56 + n % 8, n % 40, 0), value(7 + n % 2));
  for (int n = 0; n < 200; ++n) grid->tree().setValueOff(openvdb::Coord(72 + n % 8, n % 40, 0), value(n));
  for (int n = 0; n < 512; ++n)
    grid->tree().setValueOn(openvdb::Coord(n / 64, n / 8 % 8, 80 + n % 8), value(n));
  grid->tree().addTile(1, openvdb::Coord(-64, 8, 8), value(3), true);
  grid->tree().addTile(1, openvdb::Coord(-64, 16, 8), value(4), false);
  grid->tree().addTile(2, openvdb::Coord(512, 0, 0), value(5), true);
  grid->tree().addTile(3, openvdb::Coord(-8192, 4096, 0), value(6), true);
  grid->setName(name);
  return grid;
}

/// A narrow band: the inactive voxels inside have the background's other sign.
inline openvdb::GridBase::Ptr band() {
  auto const grid = openvdb::FloatGrid::create(3.0f);
  for (int x = -12; x < 12; ++x)
    for (int y = -12; y < 12; ++y)
      for (int z = -12; z < 12; ++z) {
        float const d = std::sqrt(float(x * x + y * y + z * z)) - 9;
        if (std::abs(d) < 3)
          grid->tree().setValueOn(openvdb::Coord(x, y, z), d);
        else
          grid->tree().setValueOff(openvdb::Coord(x, y, z), d < 0 ? -3.0f : 3.0f);
      }
  grid->setGridClass(openvdb::GRID_LEVEL_SET);
  grid->setTransform(openvdb::math::Transform::createLinearTransform(0.25));
  grid->setName("band");
  return grid;
}

inline openvdb::GridPtrVec everyType() {
  using namespace openvdb;
  auto const half = mixed<FloatGrid>("half", [](int n) { return 0.1f * float(n); });
  half->setSaveFloatAsHalf(true);
  half->transform().postRotate(0.3, math::Y_AXIS);
  auto const halfVectors = mixed<Vec3SGrid>("half v", [](int n) { return Vec3s(float(n), 0.1f, -1); });
  halfVectors->setSaveFloatAsHalf(true);
  halfVectors->transform().postScale(Vec3d(1, 2, 3));
  halfVectors->transform().postTranslate(Vec3d(5, 6, 7));
  auto const fog = mixed<FloatGrid>("fog", [](int n) { return float(n) / 3; });
  fog->setGridClass(GRID_FOG_VOLUME);
  fog->insertMeta("author", StringMetadata("a test"));
  return {fog,
          half,
          band(),
          halfVectors,
          mixed<DoubleGrid>("double", [](int n) { return n / 3.0; }),
          mixed<Int32Grid>("int", [](int n) { return n - 50; }),
          mixed<Int64Grid>("long", [](int n) { return Int64(n) << 33; }),
          mixed<Vec3SGrid>("v", [](int n) { return Vec3s(float(n), 1, 2); }),
          mixed<Vec3DGrid>("vd", [](int n) { return Vec3d(n, 1, 2); }),
          mixed<Vec3IGrid>("vi", [](int n) { return Vec3i(n, -1, 2); }),
          FloatGrid::create(1.5f)};
}

inline constexpr std::uint32_t kMask = openvdb::io::COMPRESS_ACTIVE_MASK;
inline constexpr std::uint32_t kCompressions[] = {
    openvdb::io::COMPRESS_NONE,  kMask,
    openvdb::io::COMPRESS_ZIP,   openvdb::io::COMPRESS_ZIP | kMask,
    openvdb::io::COMPRESS_BLOSC, openvdb::io::COMPRESS_BLOSC | kMask};

} // namespace VLN::Test
