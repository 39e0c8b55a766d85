#include "InfoPoints.h"

#include "Content.h"
#include "Interop/FileError.h"
#include "StandardOutput.h"

#include <algorithm>
#include <array>
#include <cmath>
#include <iostream>

#include <fmt/format.h>

namespace Vln {

namespace {

using namespace VLN::Interop;
using Json = nlohmann::ordered_json;

struct Row {
  std::string name, type;
  std::int64_t elements = 0;
  bool hasRange = false;
  double low = 0, high = 0;
};

template <class T>
Row rowOf(std::string const& name, std::string const& type,
          VLN::TileTree3D::Channel<PointTraits, T, 4, 0> const& channel) {
  Row row{name, type};
  for (T const& v : channel) {
    ++row.elements;
    if constexpr (std::is_arithmetic_v<T>) {
      auto const number = static_cast<double>(v);
      if (!std::isfinite(number)) continue;
      row.low = row.hasRange ? std::min(row.low, number) : number;
      row.high = row.hasRange ? std::max(row.high, number) : number;
      row.hasRange = true;
    }
  }
  return row;
}

std::vector<Row> rowsOf(PointVolume const& volume) {
  std::vector<std::string> names{kPositionsName};
  for (auto const& [name, channel] : volume.attributes) names.push_back(channel);
  std::vector<Row> rows;
  for (auto const& name : names) {
    auto const component = volume.object->component(name);
#define VLN_TRY_TYPE(type_, name_)                                                                           \
  if (auto const* channel =                                                                                  \
          dynamic_cast<VLN::TileTree3D::Channel<PointTraits, type_, 4, 0> const*>(component.get()))          \
    rows.push_back(rowOf<type_>(name, #name_, *channel));
    VLN_FOR_EACH_ELEMENT_TYPE(VLN_TRY_TYPE)
#undef VLN_TRY_TYPE
  }
  return rows;
}

using Bounds = std::array<std::array<double, 3>, 2>;

bool worldBounds(PointVolume const& volume, Bounds& bounds) {
  auto const positions = volume.object->component<PositionChannel>(kPositionsName);
  bool any = false;
  for (auto const& p : std::as_const(*positions)) {
    for (int a = 0; a < 3; ++a) {
      auto const axis = static_cast<std::size_t>(a);
      double const at = volume.origin[a] + volume.voxelSize * double(p[a]);
      bounds[0][axis] = any ? std::min(bounds[0][axis], at) : at;
      bounds[1][axis] = any ? std::max(bounds[1][axis], at) : at;
    }
    any = true;
  }
  return any;
}

} // namespace

Json pointsJson(PointVolume const& volume) {
  auto const tree = volume.object->component<PointContainer>(kPointContainerName);
  Json tiles = Json::array(), channels = Json::array();
  for (int d = 0; d <= PointTraits::kMaxDepth; ++d)
    if (auto const count = tree->tileCount(d); count > 0) tiles.push_back({{"depth", d}, {"count", count}});
  for (Row const& row : rowsOf(volume)) {
    Json j = {{"name", row.name},         {"type", row.type},       {"core", 4},      {"halo", 0},
              {"elements", row.elements}, {"active", row.elements}, {"min", nullptr}, {"max", nullptr}};
    if (row.hasRange) j["min"] = row.low, j["max"] = row.high;
    channels.push_back(std::move(j));
  }
  Memory const memory = memoryOf(*volume.object);
  Json j = {{"voxel_size", volume.voxelSize},
            {"tiles", tiles},
            {"channels", channels},
            {"memory", {{"used", memory.used}, {"allocated", memory.allocated}}},
            {"world_bounds", nullptr}};
  if (Bounds bounds; worldBounds(volume, bounds)) j["world_bounds"] = bounds;
  return j;
}

void printPoints(PointVolume const& volume, std::size_t n) {
  auto const tree = volume.object->component<PointContainer>(kPointContainerName);
  out() << fmt::format("\nobject {}: points{}{}, voxel size {:.12g} world units\n", n,
                       volume.name.empty() ? "" : " ", oneLine(volume.name, 60), volume.voxelSize);
  Bounds b;
  if (worldBounds(volume, b))
    out() << fmt::format("  world box: ({:.12g}, {:.12g}, {:.12g}) .. ({:.12g}, {:.12g}, {:.12g})\n", b[0][0],
                         b[0][1], b[0][2], b[1][0], b[1][1], b[1][2]);
  else
    out() << "  world box: none, there are no points\n";
  out() << fmt::format("\n  {:>5}  {:>12}\n", "depth", "tiles");
  for (int d = 0; d <= PointTraits::kMaxDepth; ++d)
    if (auto const count = tree->tileCount(d); count > 0) out() << fmt::format("  {:>5}  {:>12}\n", d, count);
  auto const rows = rowsOf(volume);
  std::size_t width = 7;
  for (Row const& row : rows) width = std::max(width, oneLine(row.name, 60).size());
  out() << fmt::format("\n  {:<{}}  {:<8}  {:>12}  {:>12}  {:>12}\n", "channel", width, "type", "elements",
                       "min", "max");
  for (Row const& row : rows)
    out() << fmt::format("  {:<{}}  {:<8}  {:>12}  {:>12}  {:>12}\n", oneLine(row.name, 60), width, row.type,
                         row.elements, row.hasRange ? fmt::format("{:.12g}", row.low) : "-",
                         row.hasRange ? fmt::format("{:.12g}", row.high) : "-");
  Memory const memory = memoryOf(*volume.object);
  out() << fmt::format("\n  memory: {:.2f} MB used, {:.2f} MB allocated\n", double(memory.used) / 1e6,
                       double(memory.allocated) / 1e6);
}

} // namespace Vln
