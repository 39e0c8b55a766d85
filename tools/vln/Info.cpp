#include "Commands.h"
#include "Content.h"
#include "GeometryVolume/channels/Channel.h"
#include "GeometryVolume/channels/NonLeafValues.h"
#include "GeometryVolume/core/ElementTypes.h"
#include "GeometryVolume/pools/ArrayPool.h"
#include "GeometryVolume/pools/BaseLogger.h"
#include "GeometryVolume/pools/ChannelMemoryPool.h"
#include "GeometryVolume/pools/ChannelPool.h"
#include "GeometryVolume/tiletree/Container.h"
#include "GeometryVolume/topology/VoxelTopology.h"
#include "InfoPoints.h"
#include "Interop/FileError.h"
#include "Interop/VdbImport.h"
#include "PointsFile.h"
#include "ProgressBar.h"

#include <array>
#include <cstdlib>
#include <iostream>
#include <limits>

#include <fmt/format.h>
#include <nlohmann/json.hpp>

namespace Vln {

namespace {

using namespace VLN::Interop;
namespace ArrayPool = VLN::TileTree3D::ArrayPool;
namespace ChannelPool = VLN::TileTree3D::ChannelPool;
namespace ChannelMemoryPool = VLN::TileTree3D::ChannelMemoryPool;
using VdbTraits = VLN::TileTree3D::Traits<2, 4, 0, 1>;
using Container = VLN::TileTree3D::Container<VdbTraits>;
using Json = nlohmann::ordered_json;

std::int64_t elementsOf(VdbVolume const& volume, std::string const& channel) {
  return static_cast<std::int64_t>(volume.object->component(channel)->size());
}

template <class T>
bool coarseEqualsChildrenAs(VdbVolume const& volume, std::string const& channel, bool& equal) {
  auto const values = volume.object->component<VLN::TileTree3D::Channel<VdbTraits, T, 4, 0>>(channel);
  if (!values) return false;
  auto const tree = volume.object->component<Container>(kVdbContainerName);
  auto const topology = volume.object->component<VLN::TileTree3D::VoxelTopology<VdbTraits>>(kVdbTopologyName);
  equal = !VLN::TileTree3D::checkIfNonLeafValueIsSetToChildValue(*values, *tree, topology->offsetType(), 0.0f,
                                                                 0, Container::kMaxDepth);
  return true;
}

// Whether each refined sample holds the value of the child sample at its place.
bool coarseEqualsChildren(VdbVolume const& volume, std::string const& channel) {
  bool equal = false, known = false;
#define VLN_TRY(T, NAME) known = known || coarseEqualsChildrenAs<T>(volume, channel, equal);
  VLN_FOR_EACH_ELEMENT_TYPE(VLN_TRY)
#undef VLN_TRY
  return equal;
}

std::int64_t activeVoxels(VdbVolume const& volume) {
  std::int64_t count = 0;
  for (auto const& channel : volume.channels) count += channel.activeVoxels;
  return count;
}

using Bounds = std::array<std::array<double, 3>, 2>;

// World box of the finest tiles that hold active voxels: of their eight corners, through the whole transform.
// Corners of tiles are multiples of their width.
Bounds worldBounds(VdbVolume const& volume) {
  constexpr double kFar = std::numeric_limits<double>::infinity();
  Bounds bounds{{{kFar, kFar, kFar}, {-kFar, -kFar, -kFar}}};
  constexpr int kDepth = VdbTraits::kMaxDepth, kWidth = VdbTraits::width(kDepth);
  for (int corner = 0; corner < 8; ++corner) {
    double index[3];
    for (int a = 0; a < 3; ++a)
      index[a] = corner >> a & 1 ? double(VdbTraits::align(volume.activeBox.max[a] - 1, kDepth)) + kWidth
                                 : double(VdbTraits::align(volume.activeBox.min[a], kDepth));
    auto const world = volume.indexToWorld.toWorld({index[0], index[1], index[2]});
    for (int a = 0; a < 3; ++a) {
      auto const axis = static_cast<std::size_t>(a);
      bounds[0][axis] = std::min(bounds[0][axis], world[a]);
      bounds[1][axis] = std::max(bounds[1][axis], world[a]);
    }
  }
  return bounds;
}

// A float's value in the fewest digits that name it.
double shortest(double value) {
  auto const f = static_cast<float>(value);
  return double(f) == value ? std::strtod(fmt::format("{}", f).c_str(), nullptr) : value;
}

Json channelJson(VdbVolume const& volume, VdbChannel const& channel) {
  Json j = {{"name", channel.name},
            {"type", channel.type},
            {"core", channel.core},
            {"halo", channel.halo},
            {"elements", elementsOf(volume, channel.name)},
            {"active", channel.activeVoxels},
            {"min", nullptr},
            {"max", nullptr}};
  if (channel.hasRange) j["min"] = shortest(channel.minimum), j["max"] = shortest(channel.maximum);
  return j;
}

Json volumeJson(VdbVolume const& volume) {
  auto const container = volume.object->component<Container>(kVdbContainerName);
  Json tiles = Json::array(), channels = Json::array();
  for (int depth = 0; depth <= VdbTraits::kMaxDepth; ++depth)
    if (auto const count = container->tileCount(depth); count > 0)
      tiles.push_back({{"depth", depth}, {"count", count}});
  for (auto const& channel : volume.channels) channels.push_back(channelJson(volume, channel));
  Memory const memory = memoryOf(*volume.object);
  Json j = {{"voxel_size", shortest(volume.voxelSize)},
            {"tiles", tiles},
            {"channels", channels},
            {"memory", {{"used", memory.used}, {"allocated", memory.allocated}}},
            {"world_bounds", nullptr}};
  if (!volume.activeBox.empty()) j["world_bounds"] = worldBounds(volume);
  return j;
}

void printJson(VdbImport const& content) {
  Json j = {{"file", content.file}, {"objects", Json::array()}, {"skipped", Json::array()}};
  for (auto const& volume : content.volumes) j["objects"].push_back(volumeJson(volume));
  for (auto const& volume : content.points) j["objects"].push_back(pointsJson(volume));
  for (auto const& s : content.skipped) j["skipped"].push_back({{"grid", s.grid}, {"reason", s.reason}});
  // Names in a file may be of any bytes.
  std::cout << j.dump(2, ' ', false, Json::error_handler_t::replace) << "\n";
}

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

std::string number(double value) { return fmt::format("{:.6g}", value); }

void printVolume(VdbVolume const& volume, std::size_t n) {
  auto const container = volume.object->component<Container>(kVdbContainerName);
  auto& out = std::cout;
  out << fmt::format("\nobject {}: voxel size {} world units\n", n, number(volume.voxelSize));
  if (!volume.transform.empty()) out << fmt::format("  transform: {}\n", volume.transform);
  if (volume.activeBox.empty()) {
    out << "  world box: none, no voxel is active\n";
  } else {
    auto const& a = volume.activeBox;
    Bounds const b = worldBounds(volume);
    out << fmt::format("  world box: ({}, {}, {}) .. ({}, {}, {})\n", number(b[0][0]), number(b[0][1]),
                       number(b[0][2]), number(b[1][0]), number(b[1][1]), number(b[1][2]));
    out << fmt::format("  active voxels: {} x {} x {}, from index ({}, {}, {})\n",
                       grouped(std::int64_t(a.max.x) - a.min.x), grouped(std::int64_t(a.max.y) - a.min.y),
                       grouped(std::int64_t(a.max.z) - a.min.z), a.min.x, a.min.y, a.min.z);
  }

  out << fmt::format("\n  {:>5}  {:>12}  {:>12}  {:>14}\n", "depth", "tile width", "sample width", "tiles");
  for (int depth = 0; depth <= VdbTraits::kMaxDepth; ++depth)
    if (auto const count = container->tileCount(depth); count > 0)
      out << fmt::format("  {:>5}  {:>12}  {:>12}  {:>14}\n", depth, grouped(VdbTraits::width(depth)),
                         grouped(VdbTraits::width(depth) / VdbTraits::kTDW), grouped(count));
  out << fmt::format("  {:>5}  {:>12}  {:>12}  {:>14}\n", "all", "", "", grouped(container->tileCount(-1)));

  std::size_t width = 7;
  for (auto const& channel : volume.channels) width = std::max(width, oneLine(channel.name, 60).size());
  out << fmt::format("\n  {:<{}}  {:<6} {:>4} {:>4}  {:>14}  {:>14}  {:>12}  {:>12}\n", "channel", width,
                     "type", "core", "halo", "elements", "active voxels", "min", "max");
  for (auto const& channel : volume.channels)
    out << fmt::format("  {:<{}}  {:<6} {:>4} {:>4}  {:>14}  {:>14}  {:>12}  {:>12}\n",
                       oneLine(channel.name, 60), width, channel.type, channel.core, channel.halo,
                       grouped(elementsOf(volume, channel.name)), grouped(channel.activeVoxels),
                       channel.hasRange ? number(channel.minimum) : "-",
                       channel.hasRange ? number(channel.maximum) : "-");

  for (auto const& channel : volume.channels)
    out << fmt::format("  {}: coarse values {} those of their children\n", oneLine(channel.name, 60),
                       coarseEqualsChildren(volume, channel.name) ? "equal" : "differ from");

  Memory const memory = memoryOf(*volume.object);
  auto const active = activeVoxels(volume);
  out << fmt::format("\n  memory: {:.2f} MB used, {:.2f} MB allocated", double(memory.used) / 1e6,
                     double(memory.allocated) / 1e6);
  if (active > 0)
    out << fmt::format("; {:.1f} bytes for each active voxel of a channel",
                       double(memory.used) / double(active));
  out << "\n";
}

void printTables(VdbImport const& content) {
  std::cout << content.file << "\n";
  std::size_t n = 0;
  for (auto const& volume : content.volumes) printVolume(volume, ++n);
  for (auto const& volume : content.points) printPoints(volume, ++n);
  if (n == 0) std::cout << "\nno grid came in\n";
  if (content.skipped.empty()) return;
  std::cout << "\nskipped\n";
  for (auto const& s : content.skipped)
    std::cout << fmt::format("  {}: {}\n", oneLine(s.grid, 60), oneLine(s.reason));
}

void printMemory() {
  std::cout << "\nmemory\n\n";
  VLN::BaseLogger::dump();
  ArrayPool::dump();
  ChannelPool::dump();
  std::cout << fmt::format("blocks: {} in use, {} free with {:.2f} MB\n", ChannelMemoryPool::usedStoreSize(),
                           ChannelMemoryPool::freeStoreSize(),
                           double(ChannelMemoryPool::freeStoreAvailableMemory()) / 1e6);
}

} // namespace

void info(InfoOptions const& options) {
  if (options.memory) {
    VLN::BaseLogger::enable();
    ArrayPool::enable();
    ChannelPool::enable();
    ChannelMemoryPool::enable();
  }
  VdbImport content;
  {
    ProgressBar bar;
    if (isPointsFile(options.file)) {
      PointsInput input;
      input.file = content.file = options.file;
      content.points = readPointVolumes(input, bar.progress());
    } else {
      content = importVdb(options.file, options.limits, bar.progress());
    }
  }
  for (auto const& volume : content.points) noteLosses(content.file, volume);
  if (options.json) {
    printJson(content);
  } else {
    printTables(content);
  }
  if (options.memory) printMemory();
}

} // namespace Vln
