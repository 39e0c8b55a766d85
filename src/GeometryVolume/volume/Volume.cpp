#include "GeometryVolume/volume/Volume.h"

#include "GeometryVolume/core/ElementTypes.h"
#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/topology/Command.h"

#include <algorithm>
#include <stdexcept>
#include <utility>

namespace VLN::TileTree3D {

namespace Internal {

// One for each element type, beside the fields of that type.
#define VLN_DECLARE(type, name)                                                                              \
  std::unique_ptr<FieldSlot> makeSlot_##name(Ostil::Ptr<ChannelBase> const& channel);
VLN_FOR_EACH_ELEMENT_TYPE(VLN_DECLARE)
#undef VLN_DECLARE

namespace {

constexpr char const* kTreeName = "voxel_tile_tree";
constexpr char const* kTopologyName = "voxel_component";
constexpr int kFinest = VolumeShape::kMaxDepth;

/// A slot for a channel that can be a field; else null.
std::unique_ptr<FieldSlot> makeSlot(Ostil::Ptr<ChannelBase> const& channel, VolumeTree const& tree,
                                    std::string const& topology) {
  if (!channel || channel->getTargetName() != topology || channel->minDepth() > 0 ||
      channel->depth() < kFinest)
    return nullptr;
  for (int d = 0; d <= kFinest; ++d)
    if (channel->tileCount(d) != tree.tileCount(d)) return nullptr;
#define VLN_TRY(type, name)                                                                                  \
  if (auto slot = makeSlot_##name(channel)) return slot;
  VLN_FOR_EACH_ELEMENT_TYPE(VLN_TRY)
#undef VLN_TRY
  return nullptr;
}

} // namespace
} // namespace Internal

using namespace Internal;

Volume::Volume(float voxelSize)
    : m_data(std::make_unique<VolumeData>()) {
  m_data->tree = Ostil::makePtr<VolumeTree>(kTreeName, voxelSize);
  m_data->topology = Ostil::makePtr<VolumeTopology>(kTopologyName, kVoxelOffsetCorner);
  m_data->topology->setTargetName(kTreeName);
}

Volume::Volume(VLN::Object const& object)
    : m_data(std::make_unique<VolumeData>()) {
  auto const names = object.componentRange();
  for (auto const& name : names) {
    auto topology = object.component<VolumeTopology>(name);
    auto tree = topology ? object.component<VolumeTree>(topology->getTargetName()) : nullptr;
    if (!tree) continue;
    m_data->tree = std::move(tree);
    m_data->topology = std::move(topology);
    break;
  }
  if (!m_data->tree)
    throw std::invalid_argument("the object holds no tile tree of 4 x 4 x 4 samples with a voxel topology");
  m_data->rest = object;
  m_data->rest.eraseProperty(m_data->tree->name());
  m_data->rest.eraseProperty(m_data->topology->name());
  for (auto const& name : names) {
    auto slot = makeSlot(object.component<ChannelBase>(name), *m_data->tree, m_data->topology->name());
    if (!slot) continue;
    m_data->slots.push_back(std::move(slot));
    m_data->rest.eraseProperty(name);
  }
  m_data->topologyVersion = m_data->restVersion = m_data->version;
}

Volume::Volume(Volume const& other)
    : m_data(other.m_data->share()) {}
Volume::Volume(Volume&& other) noexcept = default;
Volume& Volume::operator=(Volume const& other) {
  if (this != &other) *this = Volume(other);
  return *this;
}
Volume& Volume::operator=(Volume&& other) noexcept = default;
Volume::~Volume() = default;

void Volume::checkNewName(std::string const& name) const {
  if (name.empty()) throw std::invalid_argument("a field needs a name");
  if (m_data->find(name)) throw std::invalid_argument("the volume has a field \"" + name + "\" already");
  if (name == m_data->tree->name() || name == m_data->topology->name() || m_data->rest.hasProperty(name))
    throw std::invalid_argument("the name \"" + name + "\" is taken by another part of the volume");
}

FieldSlot& Volume::findSlot(std::string const& name) const {
  FieldSlot* const slot = m_data->find(name);
  if (!slot) throw std::invalid_argument("the volume has no field \"" + name + "\"");
  return *slot;
}

FieldSlot& Volume::addSlot(std::unique_ptr<FieldSlot> slot) {
  m_data->slots.push_back(std::move(slot));
  return *m_data->slots.back();
}

bool Volume::hasField(std::string const& name) const { return m_data->find(name) != nullptr; }

std::vector<std::string> Volume::fieldNames() const {
  std::vector<std::string> names;
  for (auto const& slot : m_data->slots) names.push_back(slot->name);
  return names;
}

void Volume::removeField(std::string const& name) {
  FieldSlot const& slot = findSlot(name);
  m_data->syncTree(); // its tiles stay
  std::erase_if(m_data->slots, [&](auto const& s) { return s.get() == &slot; });
}

std::int64_t Volume::tileCount() const { return tree().tileCount(-1); }

Volume::Topology const& Volume::topology() const {
  m_data->sync();
  return *m_data->topology;
}

VLN::Object Volume::object() const {
  m_data->sync();
  m_data->beginSharing();
  VLN::Object object = m_data->rest;
  object.addComponent(m_data->tree);
  object.addComponent(m_data->topology);
  for (auto const& slot : m_data->slots) object.addComponent(slot->channel());
  return object;
}

void Volume::addTiles(int3 const& low, int3 const& high) {
  refineWhere(low, high, [](TileBox const&) { return true; });
}

void Volume::refineWhere(int3 const& low, int3 const& high, FunctionRef<bool(TileBox const&)> predicate,
                         int depth) {
  depth = std::min(depth, kFinest);
  m_data->syncTree();
  int const root = m_data->rootDepth();
  Tree::TileLists lists;
  std::vector<int3> frontier;
  auto const meets = [&](int3 const& corner, int width) {
    for (int a = 0; a < 3; ++a)
      if (std::int64_t(corner[a]) + width <= low[a] || corner[a] >= high[a]) return false;
    return true;
  };
  std::int64_t const w = Shape::width(root);
  std::int64_t first[3], last[3];
  for (int a = 0; a < 3; ++a) {
    if (low[a] >= high[a] || high[a] <= Shape::kMinTileCoord || low[a] > Shape::kMaxTileCoord) return;
    first[a] = Shape::align(std::max(low[a], Shape::kMinTileCoord), root);
    last[a] = std::min(high[a] - 1, Shape::kMaxTileCoord);
  }
  for (std::int64_t k = first[2]; k <= last[2]; k += w)
    for (std::int64_t j = first[1]; j <= last[1]; j += w)
      for (std::int64_t i = first[0]; i <= last[0]; i += w)
        frontier.push_back({static_cast<int>(i), static_cast<int>(j), static_cast<int>(k)});
  for (int d = root + 1; d <= depth && !frontier.empty(); ++d) {
    int const width = Shape::width(d);
    std::int64_t const count = static_cast<std::int64_t>(frontier.size());
    frontier = parallelReduce(
        0, count, 256, std::vector<int3>(),
        [&](std::int64_t begin, std::int64_t end) {
          std::vector<int3> accepted;
          for (auto n = begin; n < end; ++n)
            for (int slot = 0; slot < Shape::kTileSize; ++slot) {
              int3 const corner = frontier[n] + int3{slot & 1, slot >> 1 & 1, slot >> 2} * width;
              if (meets(corner, width) && predicate({corner, width, d})) accepted.push_back(corner);
            }
          return accepted;
        },
        [](std::vector<int3> a, std::vector<int3> const& b) {
          a.insert(a.end(), b.begin(), b.end());
          return a;
        });
    for (int3 const& corner : frontier) lists[d].append(corner);
  }
  m_data->makeTiles(lists);
}

std::int64_t Volume::removeWhere(FunctionRef<bool(TileBox const&)> predicate) {
  Tree const& tree = this->tree();
  TileIndexLists lists(Shape::kDepths);
  auto& finest = lists[kFinest];
  finest = parallelReduce(
      0, tree.tileCount(kFinest), 1024, std::vector<std::int64_t>(),
      [&](std::int64_t begin, std::int64_t end) {
        std::vector<std::int64_t> going;
        for (auto n = begin; n < end; ++n) {
          auto const& tile = tree.tile(n, kFinest);
          if (tile.valid() && predicate({tile.tijk(), Shape::width(kFinest), kFinest})) going.push_back(n);
        }
        return going;
      },
      [](std::vector<std::int64_t> a, std::vector<std::int64_t> const& b) {
        a.insert(a.end(), b.begin(), b.end());
        return a;
      });
  auto const count = static_cast<std::int64_t>(finest.size());
  if (count > 0) m_data->removeTiles(lists);
  return count;
}

void Volume::fillCoarse() {
  m_data->sync();
  for (auto& slot : m_data->slots) {
    m_data->prepareWrite(*slot);
    slot->fillCoarse(*m_data);
  }
}

void Volume::fillHalos(std::string const& name) {
  m_data->sync();
  findSlot(name).fillHalo(*m_data);
}

void Volume::fillHalos() {
  m_data->sync();
  for (auto& slot : m_data->slots) slot->fillHalo(*m_data);
}

} // namespace VLN::TileTree3D
