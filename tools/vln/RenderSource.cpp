#include "RenderSource.h"

#include "Content.h"
#include "Interop/FileError.h"
#include "Interop/FileFormat.h"
#include "Interop/Mesh.h"
#include "Interop/Ply.h"
#include "Interop/VdbDetails.h"
#include "Interop/VolumeFile.h"

#include "Render/Colors.h"

#include <algorithm>
#include <array>
#include <cmath>

#include <fmt/format.h>

namespace Vln {

using namespace VLN::Interop;
using nanovtt::GridReader;
using VLN::Render::Affine;

namespace {

// By these names fields to look at are called; others come in the order of the file.
constexpr char const* kFavourites[] = {"density", "surface"};

RenderSource fromNvtt(std::string const& file, std::string const& channel) {
  RenderSource source;
  source.mapped = std::make_unique<MappedNvtt>(file);
  auto const& reader = source.mapped->reader();
  std::uint32_t found = reader.gridCount();
  std::string names;
  auto const hasBox = [](GridReader const& grid) { return grid.tileBox(0) < grid.tileBox(3); };
  for (std::uint32_t n = 0; n < reader.gridCount(); ++n) {
    auto const grid = reader.grid(n);
    names += (n ? ", " : "") + oneLine(grid.name(), 60);
    if (channel.empty() ? found == reader.gridCount() && hasBox(grid) : channel == grid.name())
      found = std::min(found, n);
  }
  if (channel.empty())
    for (char const* name : kFavourites)
      if (auto const n = reader.find(name); n < reader.gridCount() && hasBox(reader.grid(n))) found = n;
  if (found == reader.gridCount()) {
    if (channel.empty()) throw FileError(file, "has no channel with active voxels");
    throw FileError(file, "has no channel '" + oneLine(channel, 60) + "'; it has " +
                              (names.empty() ? "none" : names));
  }
  source.grid = reader.grid(found);
  source.bounds = source.mapped->bounds(found);
  source.channel = source.grid.name();
  auto const gridClass = source.grid.gridClass();
  source.gridClass = gridClass == nanovtt::GridClass::kFogVolume  ? "fog volume"
                     : gridClass == nanovtt::GridClass::kLevelSet ? "level set"
                                                                  : "";
  double const size = source.grid.voxelSize();
  for (int a = 0; a < 3; ++a) source.tileToWorld.rows[a][a] = size;
  return source;
}

// --- Points

using VLN::Render::PointCloud;
using VLN::Render::Vec3;
using VLN::Render::Vec3d;

PointAttribute const* attributeOf(PointSet const& set, std::string const& name) {
  for (auto const& attribute : set.attributes)
    if (attribute.name == name) return &attribute;
  return nullptr;
}

// What a full channel of colour is in integers; 0 for types that are none.
double fullOf(std::string const& type) { return type == "uint8" ? 255 : type == "uint16" ? 65535 : 0; }

// The colours that the points come with. Empty where they have none.
std::vector<Vec3> ownColors(PointSet const& set) {
  std::vector<Vec3> colors;
  for (char const* name : {"Cd", "color", "colour"}) {
    auto const* const a = attributeOf(set, name);
    if (!a || a->type != "float3") continue;
    for (std::size_t n = 0; n < set.size(); ++n) {
      auto const c = a->value<Velorn::Math::float3>(n);
      colors.push_back({c.x, c.y, c.z});
    }
    return colors;
  }
  std::array<PointAttribute const*, 3> const parts{attributeOf(set, "red"), attributeOf(set, "green"),
                                                   attributeOf(set, "blue")};
  for (auto const* part : parts)
    if (!part || fullOf(part->type) == 0) return colors;
  for (std::size_t n = 0; n < set.size(); ++n) {
    Vec3 c;
    for (int a = 0; a < 3; ++a) {
      auto const& part = *parts[static_cast<std::size_t>(a)];
      double const v = part.type == "uint8" ? part.value<std::uint8_t>(n) : part.value<std::uint16_t>(n);
      c[a] = static_cast<float>(std::pow(v / fullOf(part.type), 2.2));
    }
    colors.push_back(c);
  }
  return colors;
}

PointCloud cloudOf(std::string const& file, std::vector<PointSet> const& sets, int heightAxis) {
  PointCloud cloud;
  std::array<Vec3, 256> map;
  VLN::Render::colorMap("viridis", map);
  for (PointSet const& set : sets) {
    // What is nowhere, or too far away for lengths between points to be finite, is not drawn.
    constexpr double kFarthest = 1e150;
    auto const own = ownColors(set);
    std::vector<Vec3> colors;
    std::size_t const first = cloud.positions.size();
    for (std::size_t n = 0; n < set.size(); ++n) {
      auto const p = set.world(n);
      if (!(std::abs(p.x) < kFarthest && std::abs(p.y) < kFarthest && std::abs(p.z) < kFarthest)) continue;
      cloud.positions.push_back({p.x, p.y, p.z});
      if (!own.empty()) colors.push_back(own[n]);
    }
    if (own.empty() && cloud.positions.size() > first) {
      std::vector<double> heights;
      for (std::size_t n = first; n < cloud.positions.size(); ++n)
        heights.push_back(cloud.positions[n][heightAxis]);
      std::vector<double> sorted = heights;
      std::sort(sorted.begin(), sorted.end());
      double const low = sorted[sorted.size() / 200], high = sorted[sorted.size() - 1 - sorted.size() / 200];
      for (double h : heights) {
        double const t = high > low ? std::clamp((h - low) / (high - low), 0.0, 1.0) : 0.5;
        colors.push_back(map[static_cast<std::size_t>(std::lround(255 * t))]);
      }
    }
    cloud.colors.insert(cloud.colors.end(), colors.begin(), colors.end());
  }
  if (cloud.positions.empty()) throw FileError(file, "has no points that could be drawn");
  // As large as lets discs on the largest face of the box just cover it.
  Vec3d low = cloud.positions.front(), high = low;
  for (Vec3d const& p : cloud.positions)
    for (int a = 0; a < 3; ++a) low[a] = std::min(low[a], p[a]), high[a] = std::max(high[a], p[a]);
  Vec3d const e = high - low;
  double const face = std::max({e.x * e.y, e.y * e.z, e.z * e.x});
  cloud.radius = face > 0 ? 1.2 * std::sqrt(face / double(cloud.positions.size())) : 0.01 * length(e);
  return cloud;
}

// --- Grids

/// Of the channels the one: its name may be anything, and so no filter.
VLN::Object withOneChannel(VLN::Object object, std::string const& channel) {
  std::vector<std::string> others;
  for (auto const& name : object.componentRange())
    if (name != kVdbContainerName && name != kVdbTopologyName && name != channel) others.push_back(name);
  for (auto const& name : others) object.eraseProperty(name);
  return object;
}

VdbChannel const* preferred(VdbImport const& content, std::vector<std::string> const& flat) {
  auto const usable = [&](VdbChannel const& c) {
    return !c.activeBox.empty() && std::find(flat.begin(), flat.end(), c.name) != flat.end();
  };
  VdbChannel const* first = nullptr;
  for (char const* name : kFavourites)
    for (auto const& volume : content.volumes)
      if (auto const* c = volume.channel(name); c && usable(*c)) return c;
  for (auto const& volume : content.volumes)
    for (auto const& c : volume.channels)
      if (!first && usable(c)) first = &c;
  return first;
}

} // namespace

RenderSource renderSource(std::string const& file, std::string const& channel, VdbReadLimits const& limits,
                          Progress const& progress) {
  if (isNvttFile(file)) return fromNvtt(file, channel);
  RenderSource source;
  if (formatOf(file) == FileFormat::kPly && !isMeshFile(file)) {
    if (!channel.empty()) throw FileError(file, "has points, and no channel '" + oneLine(channel, 60) + "'");
    if (progress) progress("reading", 0);
    auto const set = readPly(file);
    if (set.size() == 0) throw FileError(file, "has no points");
    source.points = cloudOf(file, {set}, 2);
    return source;
  }
  auto const content = importVolumes(file, limits, progress);
  source.channel = channel;
  if (channel.empty()) {
    std::vector<std::string> flat;
    for (auto const& volume : content.volumes)
      for (auto& name : flatChannels(*volume.object, "*")) flat.push_back(std::move(name));
    auto const* const chosen = preferred(content, flat);
    if (!chosen) {
      std::vector<PointSet> sets;
      for (auto const& points : content.points)
        if (auto set = pointSetOf(points); set.size() > 0) sets.push_back(std::move(set));
      if (sets.empty())
        throw FileError(file, "has neither a channel with active voxels that can be drawn nor points");
      source.points = cloudOf(file, sets, 1);
      return source;
    }
    source.channel = chosen->name;
  }
  auto const& volume = volumeWith(content, source.channel);
  auto const& info = *volume.channel(source.channel);
  if (info.activeBox.empty()) throw FileError(file, "channel '" + source.channel + "' has no active voxel");
  auto const details = detailsOf(volume);
  source.gridClass = details[static_cast<std::size_t>(&info - volume.channels.data())].gridClass;
  if (source.gridClass == "unknown") source.gridClass.clear();
  auto const flat = flatChannels(*volume.object, "*");
  if (std::find(flat.begin(), flat.end(), source.channel) == flat.end())
    throw FileError(file, "channel '" + oneLine(source.channel, 60) +
                              "' is of a type that cannot be drawn: " + info.type);
  FlattenOptions options;
  options.haloFraction = 1;
  options.checksum = 0;
  source.flat = flattenVolume(withOneChannel(*volume.object, source.channel), options);
  nanovtt::BufferReader const reader(source.flat.buffer.data());
  if (reader.gridCount() != 1)
    throw FileError(file, "channel '" + oneLine(source.channel, 60) + "' cannot be drawn");
  source.grid = reader.grid(0);
  auto const rows = matrixOf(volume.indexToWorld);
  if (rows.empty())
    source.note = "its transform is not linear; the picture is one of index space";
  else
    for (int a = 0; a < 3; ++a) {
      auto const& row = rows[static_cast<std::size_t>(a)];
      source.tileToWorld.rows[a] = {row[0], row[1], row[2]};
      source.tileToWorld.shift[a] = row[3];
    }
  return source;
}

} // namespace Vln
