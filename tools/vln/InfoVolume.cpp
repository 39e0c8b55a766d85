#include "InfoVolume.h"

#include "Content.h"
#include "GeometryVolume/channels/Channel.h"
#include "GeometryVolume/channels/NonLeafValues.h"
#include "GeometryVolume/core/ElementTypes.h"
#include "GeometryVolume/tiletree/Container.h"
#include "GeometryVolume/topology/VoxelTopology.h"
#include "InfoPoints.h"
#include "Interop/VdbDetails.h"

#include <cmath>
#include <limits>

#include <fmt/format.h>

namespace Vln {

namespace {

using namespace VLN::Interop;
using VdbTraits = VLN::TileTree3D::Traits<2, 4, 0, 1>;
using Container = VLN::TileTree3D::Container<VdbTraits>;
using Json = nlohmann::ordered_json;

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

// The lower and the upper corner of what a box of index space covers in world space.
Bounds worldOf(VdbVolume const& volume, std::array<std::array<double, 3>, 2> const& index) {
  constexpr double kFar = std::numeric_limits<double>::infinity();
  Bounds bounds{{{kFar, kFar, kFar}, {-kFar, -kFar, -kFar}}};
  for (unsigned corner = 0; corner < 8; ++corner) {
    auto const world = volume.indexToWorld.toWorld(
        {index[corner & 1][0], index[corner >> 1 & 1][1], index[corner >> 2 & 1][2]});
    for (int a = 0; a < 3; ++a) {
      auto const axis = static_cast<std::size_t>(a);
      bounds[0][axis] = std::min(bounds[0][axis], world[a]);
      bounds[1][axis] = std::max(bounds[1][axis], world[a]);
    }
  }
  return bounds;
}

// A number as JSON has it: what is stored as a float in the fewest digits that name it, whole numbers without
// a point.
Json numberOf(VdbChannel const& channel, double value) {
  std::string const text = exactText(channel, value);
  return Json::accept(text) ? Json::parse(text) : Json(text);
}

// "1,2,3" as a list, a single number as it is.
Json listOf(std::string const& numbers) {
  std::string const list = "[" + numbers + "]";
  if (!Json::accept(list)) return numbers;
  Json const parsed = Json::parse(list);
  return parsed.size() == 1 ? parsed[0] : parsed;
}

Json metadataJson(std::vector<VdbMetadatum> const& metadata) {
  Json j = Json::object();
  for (auto const& m : metadata) j[m.name] = m.value;
  return j;
}

Json channelJson(VdbVolume const& volume, VdbChannel const& channel, VdbGridDetails const& details) {
  Json j = {{"name", channel.name},
            {"type", channel.type},
            {"core", channel.core},
            {"halo", channel.halo},
            {"elements", elementsOf(volume, channel.name)},
            {"active", channel.activeVoxels},
            {"min", nullptr},
            {"max", nullptr},
            {"class", details.gridClass},
            {"background", listOf(details.background)},
            {"half", details.half},
            {"compression", details.compression},
            {"metadata", metadataJson(details.metadata)}};
  if (channel.hasRange)
    j["min"] = numberOf(channel, channel.minimum), j["max"] = numberOf(channel, channel.maximum);
  return j;
}

Json volumeJson(VdbVolume const& volume) {
  auto const container = volume.object->component<Container>(kVdbContainerName);
  auto const details = detailsOf(volume);
  Json tiles = Json::array(), channels = Json::array();
  for (int depth = 0; depth <= VdbTraits::kMaxDepth; ++depth)
    if (auto const count = container->tileCount(depth); count > 0)
      tiles.push_back({{"depth", depth}, {"count", count}});
  for (std::size_t n = 0; n < volume.channels.size(); ++n)
    channels.push_back(channelJson(volume, volume.channels[n], details.at(n)));
  Memory const memory = memoryOf(*volume.object);
  Json j = {
      {"voxel_size", volume.voxelSize}, {"tiles", tiles},
      {"channels", channels},           {"memory", {{"used", memory.used}, {"allocated", memory.allocated}}},
      {"world_bounds", nullptr},        {"active_box", nullptr},
      {"active_world_bounds", nullptr}, {"matrix", nullptr}};
  if (!volume.activeBox.empty()) {
    auto const& a = volume.activeBox;
    j["world_bounds"] = tileBounds(volume);
    j["active_box"] = {{a.min.x, a.min.y, a.min.z}, {a.max.x - 1, a.max.y - 1, a.max.z - 1}};
    j["active_world_bounds"] = activeBounds(volume);
  }
  if (auto const matrix = matrixOf(volume.indexToWorld); !matrix.empty()) j["matrix"] = matrix;
  return j;
}

} // namespace

std::int64_t elementsOf(VdbVolume const& volume, std::string const& channel) {
  return static_cast<std::int64_t>(volume.object->component(channel)->size());
}

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

Bounds tileBounds(VdbVolume const& volume) {
  constexpr int kDepth = VdbTraits::kMaxDepth, kWidth = VdbTraits::width(kDepth);
  Bounds index;
  for (int a = 0; a < 3; ++a) {
    index[0][static_cast<std::size_t>(a)] = double(VdbTraits::align(volume.activeBox.min[a], kDepth));
    index[1][static_cast<std::size_t>(a)] =
        double(VdbTraits::align(volume.activeBox.max[a] - 1, kDepth)) + kWidth;
  }
  return worldOf(volume, index);
}

Bounds activeBounds(VdbVolume const& volume) {
  auto const& box = volume.activeBox;
  return worldOf(volume, {{{double(box.min.x), double(box.min.y), double(box.min.z)},
                           {box.max.x - 1.0, box.max.y - 1.0, box.max.z - 1.0}}});
}

std::string exactText(VdbChannel const& channel, double value) {
  // Lengths of vectors are computed as doubles, whatever their components are.
  if (channel.type == "float") return fmt::format("{}", static_cast<float>(value));
  bool const whole =
      channel.type.compare(0, 3, "int") == 0 || channel.type == "bool" || channel.type == "mask";
  if (whole && std::abs(value) < 9e18) return std::to_string(static_cast<std::int64_t>(value));
  return fmt::format("{}", value);
}

Json fileJson(VdbImport const& content) {
  Json j = {{"file", content.file}, {"objects", Json::array()}, {"skipped", Json::array()}};
  for (auto const& volume : content.volumes) j["objects"].push_back(volumeJson(volume));
  for (auto const& volume : content.points) j["objects"].push_back(pointsJson(volume));
  for (auto const& s : content.skipped) j["skipped"].push_back({{"grid", s.grid}, {"reason", s.reason}});
  j["metadata"] = metadataJson(metadataOf(content));
  return j;
}

} // namespace Vln
