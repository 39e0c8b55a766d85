// importNvtt(): from a flat buffer back to a tree with channels.
#include "GeometryVolume/channels/Channel.h"
#include "GeometryVolume/channels/ElementTraits.h"
#include "GeometryVolume/core/ElementTypes.h"
#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/pools/ChannelPool.h"
#include "GeometryVolume/topology/Command.h"
#include "GeometryVolume/utils/ChannelParser.h"
#include "Interop/ArrayFiles.h"
#include "Interop/FileError.h"
#include "Interop/Mesh.h"
#include "Interop/NvdbFile.h"
#include "Interop/NvttRead.h"
#include "Interop/VolumeFile.h"

#include <algorithm>
#include <array>
#include <bit>
#include <cmath>

namespace VLN::Interop {

namespace {

using Traits = TileTree3D::PowerOfTwoTraits;
using Tree = TileTree3D::Container<Traits>;
using Topology = TileTree3D::VoxelTopology<Traits>;
using nanovtt::GridType;
using Velorn::Math::int3;

/// Levels of tiles that lie in a block below its own.
int levelsOf(nanovtt::TileBlock const& block) {
  return std::countr_zero(static_cast<unsigned>(block.core / nanovtt::kTileWidth));
}

class Importer {
public:
  Importer(MappedNvtt const& file, std::string const& path, std::string const& filter,
           Progress const& progress)
      : m_reader(file.reader())
      , m_filter(filter)
      , m_path(path)
      , m_progress(progress) {}

  VdbImport run(std::uint64_t memoryBytes) {
    if (!m_filter.empty())
      if (auto const status = m_parser.parses(m_filter); !status)
        throw FileError(m_path, "the filter '" + oneLine(m_filter, 60) + "' is none: " + status.message);
    collectTiles(memoryBytes);
    double const voxelSize = m_reader.gridCount() ? m_reader.grid(0).voxelSize() : 1.0;
    VdbVolume volume;
    volume.voxelSize = voxelSize;
    volume.indexToWorld = IndexToWorld(voxelSize, {0, 0, 0});
    auto object = TileTree3D::Command::createVoxelVLN<Traits>(
        kVdbContainerName, kVdbTopologyName, static_cast<float>(voxelSize), TileTree3D::kVoxelOffsetCorner);
    m_tree = object->extractComponent<Tree>(kVdbContainerName);
    m_tree->tileAccessor().addTiles(m_corners);
    m_corners = {};
    m_topology = object->extractComponent<Topology>(kVdbTopologyName);
    m_topology->update(*m_tree);
    VdbImport content;
    content.file = m_path;
    for (std::uint32_t n = 0; n < m_reader.gridCount(); ++n) {
      report("filling the channels", 0.2 + 0.8 * n / m_reader.gridCount());
      auto const grid = m_reader.grid(n);
      std::string name = grid.name();
      if (name.empty()) name = "unnamed";
      if (!m_filter.empty() && !m_parser.accepts(name)) continue;
      std::string const base = name;
      for (int k = 2; object->hasProperty(name) || name == kVdbContainerName || name == kVdbTopologyName; ++k)
        name = base + "_" + std::to_string(k);
      VdbChannel channel;
      channel.name = name, channel.gridName = grid.name(), channel.core = Traits::kTDW;
      if (auto made = makeChannel(grid, channel)) {
        object->addComponent(std::move(made));
        if (!channel.activeBox.empty())
          volume.activeBox.grow(channel.activeBox.min), volume.activeBox.grow(channel.activeBox.max);
        volume.channels.push_back(channel);
      } else {
        content.skipped.push_back({channel.gridName, "this build has no channels of its type"});
      }
    }
    object->putComponent(std::move(m_topology));
    object->putComponent(std::move(m_tree));
    volume.object = std::move(object);
    content.volumes.push_back(std::move(volume));
    report("done", 1);
    return content;
  }

private:
  void report(char const* stage, double done) const {
    if (m_progress) m_progress(stage, done);
  }

  void collectTiles(std::uint64_t memoryBytes) {
    report("reading the tiles", 0);
    std::uint64_t bytes = 0;
    std::uint64_t perTile = 160;
    for (std::uint32_t n = 0; n < m_reader.gridCount(); ++n)
      perTile += 64 + Traits::kTileDataSize * nanovtt::elementBytes(m_reader.grid(n).type());
    bool const any = m_reader.gridCount() > 0;
    nanovtt::GridReader const first = any ? m_reader.grid(0) : nanovtt::GridReader();
    m_reader.container().forEachTile([&](nanovtt::TileRef const& tile) {
      // A block is its tiles again, of every level.
      int const levels = any ? levelsOf(first.block(tile.number)) : 0;
      for (int level = 0; level <= levels; ++level) {
        int const across = 1 << level, width = tile.width() >> level;
        bytes += perTile * (std::uint64_t(1) << 3 * level);
        if (bytes > memoryBytes)
          throw FileError(m_path, "its volume needs more than " + std::to_string(memoryBytes / 1000000) +
                                      " MB of memory");
        for (int n = 0; n < across * across * across; ++n)
          m_corners[tile.depth + level].append(int3{tile.corner.x + n % across * width,
                                                    tile.corner.y + n / across % across * width,
                                                    tile.corner.z + n / across / across * width});
      }
    });
  }

  Ostil::Ptr<TileTree3D::ChannelBase> makeChannel(nanovtt::GridReader const& grid, VdbChannel& info) const {
    switch (grid.type()) {
    case GridType::kFp4:
    case GridType::kFp8:
    case GridType::kFp16:
    case GridType::kFpN:
      return fill<float>(grid, info);
    default:
      break;
    }
#define VLN_TRY_TYPE(type_, name_)                                                                           \
  if (grid.type() == GridType(TileTree3D::kElementType<type_>.flatId)) return fill<type_>(grid, info);
    VLN_FOR_EACH_FLAT_ELEMENT_TYPE(VLN_TRY_TYPE)
#undef VLN_TRY_TYPE
    return nullptr;
  }

  template <class T> static T sampleOf(nanovtt::TileBlock const& block, std::uint64_t n) {
    if constexpr (std::is_same_v<T, float>)
      return block.getFloat(n);
    else
      return block.get<T>(n);
  }

  template <class T>
  Ostil::Ptr<TileTree3D::ChannelBase> fill(nanovtt::GridReader const& grid, VdbChannel& info) const {
    using ChannelT = TileTree3D::Channel<Traits, T, 4, 0>;
    T const background = sampleOf<T>(grid.defaultValue(), 0);
    auto channel = Ostil::makePtr<ChannelT>(info.name, &background, TileTree3D::kInitializeNone, false, true,
                                            0, Traits::kMaxDepth);
    channel->setTargetName(m_topology->name());
    channel->setOwner(m_topology->getTargetName());
    channel->update(*m_topology);
    for (int d = 0; d <= Traits::kMaxDepth; ++d)
      parallelFor(0, m_tree->tileCount(d),
                  [&](std::int64_t begin, std::int64_t end) {
                    for (std::int64_t n = begin; n < end; ++n) {
                      auto const& tile = m_tree->tile(n, d);
                      auto const at = m_reader.container().find(tile.ti(), tile.tj(), tile.tk(), d);
                      auto const block = grid.block(at.number);
                      int const bottom = 1 << (Traits::kMaxDepth - at.depth - levelsOf(block));
                      auto samples = channel->tileData(n, d);
                      for (int s = 0; s < ChannelT::kSize; ++s) {
                        int3 const p = tile.childDataTIJK(s % 4, s / 4 % 4, s / 16);
                        samples(s) = sampleOf<T>(block, block.index((p.x - at.corner.x) / bottom,
                                                                    (p.y - at.corner.y) / bottom,
                                                                    (p.z - at.corner.z) / bottom));
                      }
                    }
                  },
                  {.grain = 256});
    auto const& known = TileTree3D::kElementType<T>;
    info.type = *known.vdbType ? known.vdbType : known.name;
    describe(*channel, info);
    return channel;
  }

  /// What is active: in a field with both signs and a background above 0 what lies nearer to zero than the
  /// background, as in a level set; elsewhere what differs from the background.
  template <class T, class ChannelT> void describe(ChannelT const& channel, VdbChannel& info) const {
    using Facts = TileTree3D::ElementTraits<T>;
    T const background = channel.defaultValue();
    bool band = false;
    auto const overSamples = [&](auto const& f) {
      for (int d = 0; d <= Traits::kMaxDepth; ++d)
        for (std::int64_t n = 0; n < m_tree->tileCount(d); ++n) {
          auto const& tile = m_tree->tile(n, d);
          auto const samples = channel.tileData(n, d);
          for (int s = 0; s < ChannelT::kSize; ++s)
            if (tile.isLeaf(s % 4 / 2, s / 4 % 4 / 2, s / 32)) f(tile, s, samples(s));
        }
    };
    if constexpr (std::is_floating_point_v<T>) {
      if (background > 0) overSamples([&](auto const&, int, T const& v) { band = band || v < 0; });
    }
    overSamples([&](auto const& tile, int s, T const& v) {
      bool active = Facts::distance(v, background) > 0;
      if constexpr (std::is_floating_point_v<T>) active = band ? std::abs(v) < background : active;
      if (!active) return;
      std::int64_t const w = tile.voxelDataWidth();
      info.activeVoxels += w * w * w;
      int3 const low = tile.childDataTIJK(s % 4, s / 4 % 4, s / 16);
      info.activeBox.grow(low);
      info.activeBox.grow({low.x + int(w), low.y + int(w), low.z + int(w)});
      double value = 0;
      if constexpr (Facts::kComponents == 1)
        value = double(v);
      else
        value = Facts::distance(v, Facts::zero());
      if (std::isnan(value)) return;
      info.minimum = info.hasRange ? std::min(info.minimum, value) : value;
      info.maximum = info.hasRange ? std::max(info.maximum, value) : value;
      info.hasRange = true;
    });
  }
  template <class ChannelT> void describe(ChannelT const& channel, VdbChannel& info) const {
    describe<typename ChannelT::value_type, ChannelT>(channel, info);
  }

  nanovtt::BufferReader m_reader;
  std::string const& m_filter;
  Utils::ChannelParser m_parser;
  std::string m_path;
  Progress const& m_progress;
  Tree::TileLists m_corners;
  Ostil::MutablePtr<Tree> m_tree;
  Ostil::MutablePtr<Topology> m_topology;
};

} // namespace

VdbImport importNvtt(std::string const& path, VdbReadLimits const& limits, Progress const& progress) {
  MappedNvtt const file(path);
  std::uint64_t memory = limits.memoryBytes;
  if (memory == 0) memory = TileTree3D::ChannelPool::availablePhysicalMemory() / 4 * 3;
  if (memory == 0) memory = ~std::uint64_t(0);
  return Importer(file, path, limits.channels, progress).run(memory);
}

VdbImport importVolumes(std::string const& path, VdbReadLimits const& limits, Progress const& progress,
                        MeshOptions const& mesh) {
  if (isMeshFile(path)) return importMesh(path, mesh, limits, progress);
  if (isNvdbFile(path)) return importNvdb(path, limits, progress);
  if (isNpzFile(path)) return importNpz(path, limits, progress);
  if (isVtiFile(path)) return importVti(path, limits, progress);
  return isNvttFile(path) ? importNvtt(path, limits, progress) : importVdb(path, limits, progress);
}

} // namespace VLN::Interop
