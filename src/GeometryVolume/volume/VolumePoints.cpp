#include "GeometryVolume/topology/Command.h"
#include "GeometryVolume/volume/Volume.h"

#include <cmath>
#include <stdexcept>
#include <utility>

namespace VLN::TileTree3D {

using namespace Internal;

namespace {

using Positions = Channel<VolumeShape, float3, 4, 0>;
constexpr int kFinest = VolumeShape::kMaxDepth;

std::string positionsName(std::string const& name) { return name + "_positions"; }

/// The sample that holds a position; nothing for one out of the domain or that is no number.
bool sampleOf(float3 const& tilePosition, int3& out) {
  for (int a = 0; a < 3; ++a) {
    double const c = std::floor(double(tilePosition[a]));
    if (!(c >= VolumeShape::kMinTileCoord && c <= VolumeShape::kMaxTileCoord)) return false;
    out[a] = static_cast<int>(c);
  }
  return true;
}

} // namespace

std::int64_t Volume::addPoints(std::string const& name, std::span<float3 const> positions) {
  checkNewName(name);
  checkNewName(positionsName(name));
  std::vector<std::pair<int3, float3>> kept;
  kept.reserve(positions.size());
  Tree::TileLists lists;
  for (float3 const& p : positions) {
    int3 at{0, 0, 0};
    if (!sampleOf(m_data->tree->toTileSpace(p), at)) continue;
    kept.emplace_back(at, p);
    lists[kFinest].append(at);
  }
  m_data->makeTiles(lists);
  m_data->sync();
  Tree const& tree = *m_data->tree;
  Command::createPointTopology<2, 4, 0>(name, tree, m_data->rest);
  auto topology = m_data->rest.extractComponent<PointTopology<Shape>>(name);
  auto channel = Ostil::makeMutable<Positions>(positionsName(name), nullptr, kInitializeDefaultValue, false,
                                               true, 0, kFinest);
  channel->setTargetName(name);
  channel->setOwner(tree.name());
  channel->update(*topology);
  auto const accessor = tree.tileAccessor();
  {
    auto tiles = channel->tileDataAccessor();
    for (auto const& [at, p] : kept)
      tiles.tileData(accessor.treeIndex(at.x, at.y, at.z, kFinest, true)).push(p);
  }
  topology->update(*channel);
  m_data->rest.putComponent(std::move(topology));
  m_data->rest.putComponent(std::move(channel));
  return static_cast<std::int64_t>(kept.size());
}

std::vector<float3> Volume::points(std::string const& name) const {
  m_data->sync();
  auto const channel = m_data->rest.component<Positions>(positionsName(name));
  if (!channel || channel->getTargetName() != name)
    throw std::invalid_argument("the volume has no points \"" + name + "\"");
  std::vector<float3> out;
  for (float3 const& p : std::as_const(*channel)) out.push_back(p);
  return out;
}

} // namespace VLN::TileTree3D
