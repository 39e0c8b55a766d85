#include "GeometryVolume/channels/Channel.h"
#include "GeometryVolume/core/ElementTypes.h"
#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/tiletree/Container.h"
#include "Interop/DenseReaderImpl.h"
#include "Interop/ElementScalar.h"
#include "Interop/FileError.h"

#include <algorithm>
#include <cstring>
#include <utility>

namespace VLN::Interop {

namespace {

using Velorn::Math::double3;
using Velorn::Math::int3;
using DenseTraits = TileTree3D::PowerOfTwoTraits;
using Tree = TileTree3D::Container<DenseTraits>;

template <class T> class TypedReader final : public DenseReader {
  using ChannelT = TileTree3D::Channel<DenseTraits, T, 4, 0>;
  using Scalar = typename ScalarOf<T>::type;

public:
  TypedReader(Ostil::Ptr<Tree> tree, Ostil::Ptr<ChannelT> channel)
      : m_tree(std::move(tree))
      , m_channel(std::move(channel)) {
    kind = std::is_floating_point_v<Scalar> ? 'f' : std::is_signed_v<Scalar> ? 'i' : 'u';
    scalarBytes = sizeof(Scalar);
    components = kComponentsOf<T>;
  }

  void slice(IndexBox const& box, int z, int depth, int first, int last, std::byte* out) const override {
    auto const& tree = std::as_const(*m_tree);
    auto const& tiles = *std::as_const(*m_channel).tileArrays();
    std::int64_t const wide = std::int64_t(box.max.x) - box.min.x;
    int const width = depth == DenseTraits::kMaxDepth ? 1 : DenseTraits::width(depth) / DenseTraits::kTDW;
    std::size_t const bytes = static_cast<std::size_t>(last - first) * sizeof(Scalar);
    parallelFor(
        box.min.y, box.max.y,
        [&](std::int64_t begin, std::int64_t end) {
          auto const accessor = tree.tileAccessor();
          for (auto y = begin; y < end; ++y) {
            std::byte* to = out + static_cast<std::size_t>((y - box.min.y) * wide) * bytes;
            // Samples of a row that lie in one tile have one lookup.
            for (int x = box.min.x; x < box.max.x;) {
              int const stop =
                  static_cast<int>(std::min<std::int64_t>(box.max.x, (std::int64_t(x) & ~3) + 4));
              auto at = treeIndex(accessor, x, y, z, width, depth);
              while (at.valid() && elements(tiles, at).size() < std::size_t(ChannelT::kSize))
                at = accessor.tile(at).parentTreeIndex();
              for (; x < stop; ++x, to += bytes) {
                T const& value =
                    at.valid() ? elements(tiles, at)[ChannelT::ConstTile::index(
                                     accessor.tile(at).childDataIJK(x * width, int(y) * width, z * width))]
                               : m_channel->defaultValue();
                std::memcpy(to, reinterpret_cast<char const*>(&value) + std::size_t(first) * sizeof(Scalar),
                            bytes);
              }
            }
          }
        },
        {.grain = 16});
  }

  std::vector<std::byte> background() const override {
    T const value = m_channel->defaultValue();
    auto const* const bytes = reinterpret_cast<std::byte const*>(&value);
    return {bytes, bytes + sizeof value};
  }

private:
  template <class Accessor>
  static TileTree3D::TreeIndex treeIndex(Accessor const& accessor, std::int64_t x, std::int64_t y,
                                         std::int64_t z, int width, int depth) {
    for (auto const c : {x * width, y * width, z * width})
      if (c < DenseTraits::kMinTileCoord || c > DenseTraits::kMaxTileCoord) return {};
    return accessor.treeIndex(int(x * width), int(y * width), int(z * width), depth, false);
  }
  template <class Tiles> static auto const& elements(Tiles const& tiles, TileTree3D::TreeIndex const& at) {
    return tiles[at.depth][at.index];
  }

  Ostil::Ptr<Tree> m_tree;
  Ostil::Ptr<ChannelT> m_channel;
};

template <class T>
void tryType(Object const& object, std::string const& channel, std::unique_ptr<DenseReader>& result) {
  if (result) return;
  auto tree = object.component<Tree>(kVdbContainerName);
  auto typed = object.component<TileTree3D::Channel<DenseTraits, T, 4, 0>>(channel);
  if (tree && typed && typed->tileArrays() && typed->minDepth() <= 0 &&
      typed->depth() >= DenseTraits::kMaxDepth)
    result = std::make_unique<TypedReader<T>>(std::move(tree), std::move(typed));
}

int floorDivide(int a, int b) { return a / b - (a % b < 0); }

} // namespace

std::unique_ptr<DenseReader> DenseReader::of(Object const& object, std::string const& channel) {
  std::unique_ptr<DenseReader> result;
#define VLN_TRY_TYPE(type_, name_) tryType<type_>(object, channel, result);
  VLN_FOR_EACH_FILE_ELEMENT_TYPE(VLN_TRY_TYPE)
#undef VLN_TRY_TYPE
  return result;
}

DenseVolume denseVolumeOf(VdbVolume const& volume) {
  DenseVolume dense;
  dense.object = *volume.object;
  dense.indexToWorld = volume.indexToWorld;
  for (auto const& channel : volume.channels) {
    dense.channels.push_back(channel.name);
    if (channel.type == "bool" || channel.type == "mask") dense.flags.push_back(channel.name);
  }
  dense.box = volume.activeBox;
  return dense;
}

DensePlan planDense(std::string const& path, DenseVolume const& volume, bool sparse) {
  DensePlan plan;
  if (volume.channels.empty()) throw FileError(path, "there is no channel to be written");
  if (volume.depth < 0 || volume.depth > DenseTraits::kMaxDepth)
    throw FileError(path, "depth " + std::to_string(volume.depth) + " is none");
  plan.width =
      volume.depth == DenseTraits::kMaxDepth ? 1 : DenseTraits::width(volume.depth) / DenseTraits::kTDW;
  for (int a = 0; a < 3; ++a) {
    if (volume.box.min[a] >= volume.box.max[a])
      throw FileError(path, "the volume has no active voxel, and so no box that could be written");
    plan.box.min[a] = floorDivide(volume.box.min[a], plan.width);
    plan.box.max[a] = floorDivide(volume.box.max[a] - 1, plan.width) + 1;
    plan.count[a] = std::int64_t(plan.box.max[a]) - plan.box.min[a];
  }
  for (auto const& name : volume.channels) {
    auto reader = DenseReader::of(volume.object, name);
    if (!reader)
      throw FileError(path, "the channel '" + oneLine(name, 60) + "' is of a type that is not written");
    double const bytes = double(plan.count[0]) * double(plan.count[1]) * double(plan.count[2]) *
                         reader->scalarBytes * reader->components;
    if (!sparse && bytes > kMostDenseBytes)
      throw FileError(path, "a dense box of '" + oneLine(name, 60) + "' would take " +
                                std::to_string(std::int64_t(bytes / 1e9)) + " GB: choose a coarser depth");
    plan.names.push_back(name);
    plan.readers.push_back(std::move(reader));
  }
  auto const& map = volume.indexToWorld;
  if (map.besidesScale().rfind("not linear", 0) == 0)
    throw FileError(path, "the transform of the volume is not linear, which dense files cannot tell");
  double3 const origin = map.toWorld({0, 0, 0});
  for (int row = 0; row < 3; ++row) plan.toWorld[row][3] = origin[row];
  for (int column = 0; column < 3; ++column) {
    double3 unit{0, 0, 0};
    unit[column] = plan.width;
    double3 const axis = map.toWorld(unit) - origin;
    for (int row = 0; row < 3; ++row) plan.toWorld[row][column] = axis[row];
  }
  return plan;
}

} // namespace VLN::Interop
