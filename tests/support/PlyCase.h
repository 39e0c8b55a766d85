// The bytes of a .ply file as a fuzzer's input.
//
// They are either refused with one line of text, or give points that fit together, are still there when the
// file is written and read again, and are all accounted for in a volume.
#pragma once

#include "Interop/FileError.h"
#include "Interop/Ply.h"
#include "Interop/PointVolume.h"
#include "support/FuzzCheck.h"
#include "support/TempFolder.h"

#include <cmath>
#include <cstdint>
#include <string>

namespace Support {

class PlyCase {
public:
  PlyCase(std::uint8_t const* data, std::size_t size)
      : m_data(reinterpret_cast<char const*>(data))
      , m_size(size) {}

  /// @return Whether the bytes were accepted.
  bool run() const {
    using namespace VLN::Interop;
    PointSet points;
    try {
      points = parsePly("case.ply", m_data, m_size);
    } catch (FileError const& error) {
      checkMessage(error);
      return false;
    }
    checkPoints(points);
    checkFinite(points);
    if (points.size() <= kMostRead) checkAgain(points);
    if (points.size() <= kMostBuilt) checkVolume(points);
    return true;
  }

private:
  static constexpr std::size_t kMostRead = 4096, kMostBuilt = 256;

  using PointSet = VLN::Interop::PointSet;

  static void checkMessage(VLN::Interop::FileError const& error) {
    demand(error.what() == "case.ply: " + error.reason(), "the message does not name the file");
    demandOneLine(error.reason());
  }

  void checkPoints(PointSet const& points) const {
    // A point takes three characters at least, and as many blanks but one.
    demand(points.size() * 3 <= m_size, "there are more points than bytes for them");
    demand(std::isfinite(points.voxelSize) && points.voxelSize > 0, "the voxel size is no size");
    for (int a = 0; a < 3; ++a) demand(std::isfinite(points.origin[a]), "the origin is nowhere");
    for (auto const& attribute : points.attributes)
      demand(attribute.bytes.size() == attribute.valueSize * points.size(),
             "an attribute has not one value for each point");
  }

  static bool somewhere(Velorn::Math::float3 const& p) {
    return std::isfinite(p.x) && std::isfinite(p.y) && std::isfinite(p.z);
  }
  /// What is somewhere at a voxel size of 1 is so at the size chosen.
  void checkFinite(PointSet const& points) const {
    PointSet const plain = VLN::Interop::parsePly("case.ply", m_data, m_size, {1.0, 64});
    demand(plain.size() == points.size(), "the number of points depends on the voxel size");
    for (std::size_t n = 0; n < points.size(); ++n)
      demand(!somewhere(plain.positions[n]) || somewhere(points.positions[n]),
             "a point is somewhere only at another voxel size");
  }

  /// Equal as far as a float tells that counts from an origin.
  static bool close(double a, double b, double origin, double unit) {
    return a == b ||
           std::abs(a - b) <= unit * 0x1p-20 + 0x1p-22 * std::max(std::abs(a - origin), std::abs(a));
  }
  static void checkAgain(PointSet const& points) {
    static VLN::Test::TempFolder const folder;
    std::string const path = folder / "case.ply";
    VLN::Interop::writePly(path, points);
    PointSet const again = VLN::Interop::readPly(path);
    demand(again.size() == points.size(), "another number of points is read again");
    demand(again.doublePositions == points.doublePositions, "positions change their type");
    demand(again.attributes.size() == points.attributes.size(), "another number of attributes is read again");
    for (std::size_t n = 0; n < points.attributes.size(); ++n) {
      auto const &a = points.attributes[n], &b = again.attributes[n];
      demand(a.name == b.name && a.type == b.type && a.bytes == b.bytes, "an attribute changes");
    }
    double const unit = std::max(points.voxelSize, again.voxelSize);
    for (std::size_t n = 0; n < points.size(); ++n) {
      bool const is = somewhere(points.positions[n]);
      demand(is == somewhere(again.positions[n]), "a point comes or goes");
      for (int a = 0; is && a < 3; ++a)
        demand(close(points.world(n)[a], again.world(n)[a], points.origin[a], unit), "a point moves");
    }
  }

  static void checkVolume(PointSet const& points) {
    auto const volume = VLN::Interop::buildPointVolume(points);
    auto const left = VLN::Interop::pointSetOf(volume);
    demand(volume.dropped >= 0 && left.size() + static_cast<std::size_t>(volume.dropped) == points.size(),
           "points are lost in the volume");
    for (auto const& p : left.positions)
      demand(std::isfinite(p.x) && std::isfinite(p.y) && std::isfinite(p.z),
             "a volume has a point that is nowhere");
  }

  char const* m_data;
  std::size_t m_size;
};

} // namespace Support
