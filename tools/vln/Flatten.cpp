#include "Commands.h"
#include "Content.h"
#include "Interop/FileError.h"
#include "Interop/FileFormat.h"
#include "Interop/NvttRead.h"
#include "Interop/NvttWrite.h"
#include "Interop/VolumeFile.h"
#include "ProgressBar.h"
#include "Render/Bounds.h"
#include "StandardOutput.h"

#include <chrono>
#include <iostream>
#include <vector>

#include <fmt/format.h>

namespace Vln {

using namespace VLN::Interop;

namespace {

// The one volume with channels that pass: a flat buffer has one tree.
VdbVolume const& volumeFor(VdbImport const& content, std::string const& filter) {
  VdbVolume const* found = nullptr;
  std::size_t count = 0;
  for (auto const& volume : content.volumes) {
    if (flatChannels(*volume.object, filter).empty()) continue;
    ++count;
    if (!found) found = &volume;
  }
  if (!found)
    throw FileError(content.file, "has no channel that passes '" + oneLine(filter, 60) +
                                      "' and that a flat "
                                      "buffer can hold");
  if (count > 1)
    throw FileError(content.file,
                    fmt::format("its channels lie in {} objects with different transforms; choose "
                                "those of one with --channels",
                                count));
  return *found;
}

std::string megabytes(std::uint64_t bytes) { return fmt::format("{:.2f} MB", double(bytes) / 1e6); }

// Of each grid's tiles.
struct Bounds {
  std::vector<std::vector<unsigned char>> grids;
  double seconds = 0;
};
Bounds boundsOf(FlatVolume const& flat, int bits) {
  Bounds bounds;
  if (bits == 0) return bounds;
  auto const began = std::chrono::steady_clock::now();
  nanovtt::BufferReader const reader(flat.buffer.data());
  for (std::uint32_t n = 0; n < reader.gridCount(); ++n)
    bounds.grids.push_back(VLN::Render::makeBounds(reader.grid(n), {-1, bits, 0}));
  bounds.seconds = std::chrono::duration<double>(std::chrono::steady_clock::now() - began).count();
  return bounds;
}

void report(VdbVolume const& volume, FlatVolume const& flat, Bounds const& bounds, bool quantised) {
  nanovtt::BufferReader const reader(flat.buffer.data());
  auto const& container = reader.container();
  std::uint64_t halos = 0;
  if (reader.gridCount() > 0) {
    auto const grid = reader.grid(0);
    for (std::uint32_t n = 0; n < container.tileCount(); ++n) halos += grid.block(n).hasHalo();
  }
  std::int64_t voxels = 0;
  std::ostream& text = out();
  text << fmt::format("  tiles       {}, {} of them with a halo, roots at depth {}\n", container.tileCount(),
                      halos, container.rootDepth());
  text << fmt::format("  container   {}\n", megabytes(container.containerSize()));
  for (std::uint32_t n = 0; n < reader.gridCount(); ++n) {
    auto const grid = reader.grid(n);
    VdbChannel const* const channel = volume.channel(grid.name());
    if (channel) voxels = std::max(voxels, channel->activeVoxels);
    text << fmt::format("  grid        {}, {}\n", megabytes(grid.gridSize()), oneLine(grid.name(), 60));
  }
  if (!flat.traversal.empty()) text << fmt::format("  traversal   {}\n", megabytes(flat.traversal.size()));
  if (!flat.neighbors.empty()) text << fmt::format("  neighbours  {}\n", megabytes(flat.neighbors.size()));
  if (!bounds.grids.empty())
    text << fmt::format("  bounds      {} a grid; made in {:.1f} ms\n",
                        megabytes(bounds.grids.front().size()), bounds.seconds * 1e3);
  std::string const each =
      voxels > 0 ? fmt::format(", {:.2f} bytes per active voxel", double(flat.buffer.size()) / double(voxels))
                 : "";
  text << fmt::format("  buffer      {}{}; made in {:.1f} ms, {:.2f} GB/s\n", megabytes(flat.buffer.size()),
                      each, flat.seconds * 1e3,
                      double(flat.buffer.size()) / 1e9 / std::max(flat.seconds, 1e-9));
  if (!quantised) return;
  for (auto const& error : flatErrors(*volume.object, flat))
    text << fmt::format("  error       largest {:.3g}, mean {:.3g}, {}\n", error.largest, error.mean,
                        oneLine(error.channel, 60));
}

} // namespace

void flatten(FlattenOptions const& options) {
  checkOutputFor(FileContent::kFlatBuffers, options.output);
  VdbImport content;
  FlatVolume flat;
  Bounds bounds;
  VdbVolume const* volume = nullptr;
  {
    ProgressBar bar;
    content = importVolumes(options.file, options.limits, bar.progress(0, 0.7));
    volume = &volumeFor(content, options.flat.channels);
    auto const progress = bar.progress(0.7, 1); // empty where nobody looks
    if (progress) progress("flattening", 0);
    try {
      flat = flattenVolume(*volume->object, options.flat);
    } catch (FileError const&) { throw; } catch (std::runtime_error const& error) {
      throw FileError(options.file, error.what());
    }
    bounds = boundsOf(flat, options.boundsBits);
    if (progress) progress("writing", 0.5);
    NvttContent file{flat.buffer.data(),
                     flat.buffer.size(),
                     flat.traversal.data(),
                     flat.traversal.size(),
                     flat.neighbors.data(),
                     flat.neighbors.size(),
                     {}};
    for (std::uint32_t n = 0; n < bounds.grids.size(); ++n)
      file.bounds.push_back({n, bounds.grids[n].data(), bounds.grids[n].size()});
    writeNvtt(options.output, file);
  }
  std::ostream& text = remarks(options.output);
  text << options.output << '\n';
  if (&text == &out()) report(*volume, flat, bounds, options.flat.quantisation != Quantisation::kNone);
  if (!volume->transform.empty())
    std::cerr << fmt::format("vln: {}: note: a flat buffer holds one voxel size; the transform is {}\n",
                             options.file, volume->transform);
  for (auto const& points : content.points)
    std::cerr << fmt::format("vln: {}: note: '{}' is left out: it holds points\n", options.file,
                             oneLine(points.name, 60));
  auto const kept = flatChannels(*volume->object, options.flat.channels);
  for (auto const& channel : volume->channels)
    if (std::find(kept.begin(), kept.end(), channel.name) == kept.end() && options.flat.channels == "*")
      std::cerr << fmt::format("vln: {}: note: '{}' is left out: a flat buffer holds no {}\n", options.file,
                               oneLine(channel.name, 60), channel.type);
  leaveToSystem(std::move(content));
}

void validate(ValidateOptions const& options) {
  MappedNvtt const file(options.file, NvttCheck::kPages);
  auto const& reader = file.reader();
  out() << fmt::format("{}: sound; {} tiles, {} {}, {} bytes\n", options.file, reader.container().tileCount(),
                       reader.gridCount(), reader.gridCount() == 1 ? "grid" : "grids", file.bufferLength());
}

} // namespace Vln
