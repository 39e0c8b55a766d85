#include "Commands.h"
#include "Content.h"
#include "GeometryVolume/pools/ArrayPool.h"
#include "GeometryVolume/pools/BaseLogger.h"
#include "GeometryVolume/pools/ChannelMemoryPool.h"
#include "GeometryVolume/pools/ChannelPool.h"
#include "GeometryVolume/tiletree/Container.h"
#include "InfoPoints.h"
#include "InfoVolume.h"
#include "Interop/FileError.h"
#include "Interop/Mesh.h"
#include "Interop/VdbDetails.h"
#include "Interop/VolumeFile.h"
#include "PointsFile.h"
#include "ProgressBar.h"
#include "StandardOutput.h"

#include <algorithm>
#include <iostream>

#include <fmt/format.h>
#include <glob.h>
#include <unistd.h>

namespace Vln {

namespace {

using namespace VLN::Interop;
namespace ArrayPool = VLN::TileTree3D::ArrayPool;
namespace ChannelPool = VLN::TileTree3D::ChannelPool;
namespace ChannelMemoryPool = VLN::TileTree3D::ChannelMemoryPool;
using VdbTraits = VLN::TileTree3D::Traits<2, 4, 0, 1>;
using Container = VLN::TileTree3D::Container<VdbTraits>;

// 1234567 as "1,234,567".
std::string grouped(std::int64_t n) {
  std::string const digits = std::to_string(n);
  std::string text;
  for (std::size_t at = 0; at < digits.size(); ++at) {
    if (at > 0 && digits[at - 1] != '-' && (digits.size() - at) % 3 == 0) text += ',';
    text += digits[at];
  }
  return text;
}

// Enough for a hundredth of a millimetre at any place on the earth.
std::string number(double value) { return fmt::format("{:.12g}", value); }
std::string triple(std::array<double, 3> const& p) {
  return fmt::format("({}, {}, {})", number(p[0]), number(p[1]), number(p[2]));
}

// Columns that stand, for names of any script.
std::size_t columnsOf(std::string const& text) {
  return static_cast<std::size_t>(
      std::count_if(text.begin(), text.end(), [](char c) { return (c & 0xc0) != 0x80; }));
}
std::string padded(std::string const& text, std::size_t width) {
  return text + std::string(width - std::min(width, columnsOf(text)), ' ');
}

void printMetadata(std::vector<VdbMetadatum> const& metadata, char const* indent) {
  for (auto const& m : metadata)
    out() << fmt::format("{}{}: {}\n", indent, oneLine(m.name, 60), oneLine(m.value, 200));
}

// The rows of a transform that is more than a scale.
void printTransform(VdbVolume const& volume) {
  if (volume.transform.empty()) return;
  out() << fmt::format("  transform: {}\n", volume.transform);
  for (auto const& row : matrixOf(volume.indexToWorld)) {
    out() << "   ";
    for (double const v : row) out() << fmt::format(" {:>14}", number(v));
    out() << "\n";
  }
}

void printDetails(VdbVolume const& volume) {
  auto const details = detailsOf(volume);
  for (std::size_t n = 0; n < volume.channels.size(); ++n) {
    auto const& d = details.at(n);
    out() << fmt::format("  {}: {}, background {}{}{}\n", oneLine(volume.channels[n].name, 60), d.gridClass,
                         d.background, d.half ? ", stored as 16-bit floats" : "",
                         d.compression.empty() ? "" : ", compression " + oneLine(d.compression, 60));
    printMetadata(d.metadata, "    ");
  }
}

void printCoarse(VdbVolume const& volume) {
  std::string equal, differ;
  for (auto const& channel : volume.channels) {
    std::string& list = coarseEqualsChildren(volume, channel.name) ? equal : differ;
    list += (list.empty() ? "" : ", ") + oneLine(channel.name, 60);
  }
  if (differ.empty() && volume.channels.size() > 1) equal = "all channels";
  if (!equal.empty()) out() << fmt::format("  coarse values equal those of their children: {}\n", equal);
  if (!differ.empty())
    out() << fmt::format("  coarse values differ from those of their children: {}\n", differ);
}

void printVolume(VdbVolume const& volume, std::size_t n) {
  auto const container = volume.object->component<Container>(kVdbContainerName);
  out() << fmt::format("\nobject {}: voxel size {} world units\n", n, number(volume.voxelSize));
  printTransform(volume);
  if (volume.activeBox.empty()) {
    out() << "  world box: none, no voxel is active\n";
  } else {
    auto const& a = volume.activeBox;
    Bounds const tiles = tileBounds(volume), active = activeBounds(volume);
    out() << fmt::format("  world box: {} .. {}\n", triple(tiles[0]), triple(tiles[1]));
    out() << fmt::format("  active voxels: {} x {} x {}, from index ({}, {}, {}) to ({}, {}, {})\n",
                         grouped(std::int64_t(a.max.x) - a.min.x), grouped(std::int64_t(a.max.y) - a.min.y),
                         grouped(std::int64_t(a.max.z) - a.min.z), a.min.x, a.min.y, a.min.z, a.max.x - 1,
                         a.max.y - 1, a.max.z - 1);
    out() << fmt::format("  in the world from {} to {}\n", triple(active[0]), triple(active[1]));
  }

  out() << fmt::format("\n  {:>5}  {:>12}  {:>12}  {:>14}\n", "depth", "tile width", "sample width", "tiles");
  for (int depth = 0; depth <= VdbTraits::kMaxDepth; ++depth)
    if (auto const count = container->tileCount(depth); count > 0)
      out() << fmt::format("  {:>5}  {:>12}  {:>12}  {:>14}\n", depth, grouped(VdbTraits::width(depth)),
                           grouped(VdbTraits::width(depth) / VdbTraits::kTDW), grouped(count));
  out() << fmt::format("  {:>5}  {:>12}  {:>12}  {:>14}\n", "all", "", "", grouped(container->tileCount(-1)));

  std::size_t width = 7;
  for (auto const& channel : volume.channels) width = std::max(width, columnsOf(oneLine(channel.name, 60)));
  out() << fmt::format("\n  {}  {:<6} {:>4} {:>4}  {:>14}  {:>14}  {:>12}  {:>12}\n",
                       padded("channel", width), "type", "core", "halo", "elements", "active voxels", "min",
                       "max");
  for (auto const& channel : volume.channels)
    out() << fmt::format("  {}  {:<6} {:>4} {:>4}  {:>14}  {:>14}  {:>12}  {:>12}\n",
                         padded(oneLine(channel.name, 60), width), channel.type, channel.core, channel.halo,
                         grouped(elementsOf(volume, channel.name)), grouped(channel.activeVoxels),
                         channel.hasRange ? exactText(channel, channel.minimum) : "-",
                         channel.hasRange ? exactText(channel, channel.maximum) : "-");
  out() << "\n";
  printDetails(volume);
  printCoarse(volume);

  Memory const memory = memoryOf(*volume.object);
  auto const active = activeVoxels(volume);
  out() << fmt::format("\n  memory: {:.2f} MB used, {:.2f} MB allocated", double(memory.used) / 1e6,
                       double(memory.allocated) / 1e6);
  if (active > 0)
    out() << fmt::format("; {:.1f} bytes for each active voxel of a channel",
                         double(memory.used) / double(active));
  out() << "\n";
}

void printTables(VdbImport const& content) {
  out() << content.file << "\n";
  printMetadata(metadataOf(content), "  ");
  std::size_t n = 0;
  for (auto const& volume : content.volumes) printVolume(volume, ++n);
  for (auto const& volume : content.points) printPoints(volume, ++n);
  if (n == 0) out() << "\nno grid came in\n";
  if (content.skipped.empty()) return;
  out() << "\nskipped\n";
  for (auto const& s : content.skipped)
    out() << fmt::format("  {}: {}\n", oneLine(s.grid, 60), oneLine(s.reason));
}

void printMemory() {
  OwnLines const own; // the pools print to std::cout
  out() << "\nmemory\n\n";
  VLN::BaseLogger::dump();
  ArrayPool::dump();
  ChannelPool::dump();
  out() << fmt::format("blocks: {} in use, {} free with {:.2f} MB\n", ChannelMemoryPool::usedStoreSize(),
                       ChannelMemoryPool::freeStoreSize(),
                       double(ChannelMemoryPool::freeStoreAvailableMemory()) / 1e6);
}

// One line for a file.
void printBrief(VdbImport const& content) {
  std::string grids;
  std::int64_t active = 0;
  std::uint64_t used = 0;
  auto const add = [&](std::string const& name, std::string const& type) {
    grids += fmt::format("{}{} ({})", grids.empty() ? "" : ", ", oneLine(name, 60), type);
  };
  for (auto const& volume : content.volumes) {
    for (auto const& channel : volume.channels) add(channel.name, channel.type);
    active += activeVoxels(volume), used += memoryOf(*volume.object).used;
  }
  for (auto const& volume : content.points) {
    add(volume.name.empty() ? "points" : volume.name, "points");
    active += static_cast<std::int64_t>(volume.object->component(kPositionsName)->size());
    used += memoryOf(*volume.object).used;
  }
  out() << fmt::format("{}: {}; {} active; {:.2f} MB{}\n", content.file, grids.empty() ? "no grid" : grids,
                       grouped(active), double(used) / 1e6,
                       content.skipped.empty() ? "" : fmt::format("; {} skipped", content.skipped.size()));
}

VdbImport read(std::string const& file, InfoOptions const& options) {
  VdbImport content;
  {
    ProgressBar bar;
    if (isPointsFile(file) && !isMeshFile(file)) {
      PointsInput input;
      input.file = content.file = file;
      content.points = readPointVolumes(input, bar.progress());
    } else {
      content = importVolumes(file, options.limits, bar.progress());
    }
  }
  for (auto const& volume : content.points) noteLosses(content.file, volume);
  return content;
}

// Patterns that the shell has left as they are, such as "*.vdb" in quotes.
std::vector<std::string> filesOf(std::vector<std::string> const& names) {
  std::vector<std::string> files;
  for (std::string const& name : names) {
    glob_t found = {};
    bool const pattern = name.find_first_of("*?[") != std::string::npos && access(name.c_str(), F_OK) != 0;
    if (pattern && glob(name.c_str(), 0, nullptr, &found) == 0)
      files.insert(files.end(), found.gl_pathv, found.gl_pathv + found.gl_pathc);
    else
      files.push_back(name);
    if (pattern) globfree(&found);
  }
  return files;
}

} // namespace

void info(InfoOptions const& options) {
  if (options.memory) {
    VLN::BaseLogger::enable();
    ArrayPool::enable();
    ChannelPool::enable();
    ChannelMemoryPool::enable();
  }
  auto const files = filesOf(options.files);
  bool const several = files.size() > 1;
  bool failed = false;
  auto list = nlohmann::ordered_json::array();
  for (std::size_t n = 0; n < files.size(); ++n) {
    try {
      VdbImport content = read(files[n], options);
      if (options.json) {
        list.push_back(fileJson(content));
      } else if (options.brief) {
        printBrief(content);
      } else {
        if (n > 0) out() << "\n";
        printTables(content);
      }
      if (options.memory) printMemory();
      if (n + 1 == files.size()) leaveToSystem(std::move(content));
    } catch (FileError const& error) {
      if (!several) throw;
      // The others are worth their while.
      out().flush();
      std::cerr << "vln: " << oneLine(error.what(), 1000) << "\n";
      failed = true;
    }
  }
  // Names in a file may be of any bytes.
  if (options.json)
    out() << (several ? list : list.at(0)).dump(2, ' ', false, nlohmann::json::error_handler_t::replace)
          << "\n";
  if (failed) {
    out().flush();
    throw AlreadyTold();
  }
}

} // namespace Vln
