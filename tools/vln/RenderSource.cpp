#include "RenderSource.h"

#include "Content.h"
#include "Interop/FileError.h"
#include "Interop/VdbDetails.h"
#include "Interop/VolumeFile.h"

#include <algorithm>
#include <stdexcept>

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
  source.channel = source.grid.name();
  auto const gridClass = source.grid.gridClass();
  source.gridClass = gridClass == nanovtt::GridClass::kFogVolume  ? "fog volume"
                     : gridClass == nanovtt::GridClass::kLevelSet ? "level set"
                                                                  : "";
  double const size = source.grid.voxelSize();
  for (int a = 0; a < 3; ++a) source.tileToWorld.rows[a][a] = size;
  return source;
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
  auto const content = importVolumes(file, limits, progress);
  RenderSource source;
  source.channel = channel;
  if (channel.empty()) {
    std::vector<std::string> flat;
    for (auto const& volume : content.volumes)
      for (auto& name : flatChannels(*volume.object, "*")) flat.push_back(std::move(name));
    auto const* const chosen = preferred(content, flat);
    if (!chosen) throw FileError(file, "has no channel with active voxels that can be drawn");
    source.channel = chosen->name;
  }
  auto const& volume = volumeWith(content, source.channel);
  auto const& info = *volume.channel(source.channel);
  if (info.activeBox.empty()) throw FileError(file, "channel '" + source.channel + "' has no active voxel");
  auto const details = detailsOf(volume);
  source.gridClass = details[static_cast<std::size_t>(&info - volume.channels.data())].gridClass;
  FlattenOptions options;
  options.channels = source.channel;
  options.haloFraction = 1;
  options.checksum = 0;
  source.flat = flattenVolume(*volume.object, options);
  nanovtt::BufferReader const reader(source.flat.buffer.data());
  source.grid = reader.grid(reader.find(source.channel.c_str()));
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
