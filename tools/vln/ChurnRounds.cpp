#include "ChurnRounds.h"

#include "GeometryVolume/channels/Channel.h"
#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/pools/ArrayPool.h"
#include "GeometryVolume/pools/ChannelMemoryPool.h"
#include "GeometryVolume/pools/ChannelPool.h"
#include "GeometryVolume/pools/PoolUtils.h"
#include "GeometryVolume/tiletree/Container.h"
#include "GeometryVolume/topology/VoxelTopology.h"
#include "Interop/VdbImport.h"
#include "ProgressBar.h"

#include <algorithm>
#include <chrono>
#include <fstream>
#include <iostream>
#include <malloc.h>
#include <string>
#include <typeindex>
#include <vector>

namespace Vln {

namespace {

using namespace VLN::TileTree3D;
using namespace VLN::Interop;
using Shape = Traits<2, 4, 0, 1>;
using Tree = Container<Shape>;
using Topology = VoxelTopology<Shape>;
template <int E, int H> using Floats = Channel<Shape, float, E, H>;
using Source = Floats<4, 0>;

struct Volume {
  Ostil::Ptr<Tree> tree;
  Ostil::Ptr<Topology> topology;
  std::vector<Ostil::Ptr<Source>> channels;
};

std::vector<Volume> volumesOf(VdbImport const& content) {
  std::vector<Volume> volumes;
  for (auto const& v : content.volumes) {
    Volume volume{
        v.object->component<Tree>(kVdbContainerName), v.object->component<Topology>(kVdbTopologyName), {}};
    for (auto const& c : v.channels) volume.channels.push_back(v.object->component<Source>(c.name));
    volumes.push_back(std::move(volume));
  }
  return volumes;
}

/// A channel without tiles of its own yet, or one that has served before.
template <int E, int H>
Ostil::Ptr<Floats<E, H>> take(bool pools, float background, bool isStatic, Topology const& topology) {
  auto const tiles = static_cast<std::uint64_t>(topology.tileCount(-1));
  // All values are written below, so none is constructed.
  auto channel = pools ? ChannelPool::allocate<Shape, float, E, H>(background, isStatic, false, 0,
                                                                   Shape::kMaxDepth, tiles, &topology)
                       : Ostil::makePtr<Floats<E, H>>("working", &background, kInitializeNone, isStatic,
                                                      false, 0, Shape::kMaxDepth);
  channel->update(topology);
  return channel;
}

template <class Body> void forEachTile(Topology const& topology, Body const& body) {
  for (int depth = 0; depth <= Shape::kMaxDepth; ++depth)
    VLN::parallelFor(0, topology.tileCount(depth),
                     [&](std::int64_t begin, std::int64_t end) {
                       for (std::int64_t tile = begin; tile < end; ++tile) body(tile, depth);
                     },
                     {.grain = 256});
}

/// The core of each tile; what lies round it takes the background.
template <class To> void copyValues(To& to, Source const& from, Topology const& topology, float background) {
  to.cloneData();
  forEachTile(topology, [&](std::int64_t tile, int depth) {
    auto target = to.tileData(tile, depth);
    auto const source = from.tileData(tile, depth);
    if constexpr (To::kSize == Source::kSize) {
      std::copy_n(&source[0], Source::kSize, &target[0]);
    } else {
      std::fill_n(&target[0], To::kSize, background);
      for (int k = 0; k < 4; ++k)
        for (int j = 0; j < 4; ++j)
          for (int i = 0; i < 4; ++i) target(i, j, k) = source(i, j, k);
    }
  });
}

template <int E, int H> double round(Volume const& volume, Source const& source, bool pools) {
  Tree const tree(*volume.tree);
  Topology topology(*volume.topology);
  topology.update(tree);
  float const background = source.defaultValue();
  auto const loaded = take<4, 0>(pools, background, true, topology);
  copyValues(*loaded, source, topology, background);
  auto const work = take<E, H>(pools, background, false, topology);
  copyValues(*work, *loaded, topology, background);
  constexpr int kSize = Floats<E, H>::kSize;
  forEachTile(topology, [&](std::int64_t tile, int depth) {
    auto data = work->tileData(tile, depth);
    for (int e = 0; e < kSize; ++e) data[e] = 0.5f * data[e] + 0.25f;
  });
  auto const flat = Ostil::staticCast<Ostil::Array<float>>(
      work->channelData(0, Ostil::Any(std::type_index(typeid(float)))));
  double sum = 0;
  std::uint64_t const step = std::max<std::uint64_t>(1, flat->size() / 1000);
  for (std::uint64_t i = 0; i < flat->size(); i += step) sum += (*flat)[i];
  return sum;
}

/// From now on the system's peak counts anew. Not every system can.
void forgetPeak() {
  malloc_trim(0);
  std::ofstream("/proc/self/clear_refs") << "5\n";
}

std::uint64_t peakResident() {
  std::ifstream file("/proc/self/status");
  for (std::string line; std::getline(file, line);)
    if (line.starts_with("VmHWM:")) return std::stoull(line.substr(6)) * 1024;
  return 0;
}

/// Channels with static storage say on standard error, each time that they are measured, that their blocks
/// are not counted beside their tiles; nobody here can do anything about it.
class QuietErrors {
public:
  QuietErrors()
      : m_before(std::cerr.rdbuf(nullptr)) {}
  ~QuietErrors() {
    std::cerr.rdbuf(m_before);
    std::cerr.clear();
  }

private:
  std::streambuf* m_before;
};

void enablePools(std::uint64_t limit) {
  PoolUtils::setProcessLimit(limit);
  ChannelMemoryPool::enable();
  ArrayPool::enable();
  ChannelPool::enable();
  // Some room for what the pools do not see: tile records, lists, stacks.
  std::uint64_t const room = limit / 32;
  ArrayPool::enableRequiredFreeSize();
  ChannelPool::enableRequiredFreeSize();
  ArrayPool::setRequiredFreeSize(room);
  ChannelPool::setRequiredFreeSize(room);
}

} // namespace

ChurnFigures runChurn(ChurnOptions const& options, bool pools) {
  ProgressBar bar;
  ChurnFigures figures;
  std::vector<Volume> volumes;
  {
    VdbImport const content = importVdb(options.file, options.limits, bar.progress(0, 0.2));
    volumes = volumesOf(content);
    for (auto const& v : content.volumes)
      for (auto const& c : v.channels) figures.voxels += c.activeVoxels;
  }
  forgetPeak();
  if (pools) enablePools(options.limitBytes);

  using Clock = std::chrono::steady_clock;
  auto const begin = Clock::now();
  for (int r = 0; r < options.rounds; ++r) {
    bar.show(pools ? "rounds with pools" : "rounds without pools", 0.2 + 0.8 * r / options.rounds);
    QuietErrors const quiet;
    for (auto const& volume : volumes)
      for (auto const& channel : volume.channels) {
        if (r % 3 == 0) figures.checksum += round<4, 0>(volume, *channel, pools);
        if (r % 3 == 1) figures.checksum += round<4, 1>(volume, *channel, pools);
        if (r % 3 == 2) figures.checksum += round<5, 0>(volume, *channel, pools);
      }
  }
  figures.seconds = std::chrono::duration<double>(Clock::now() - begin).count() / options.rounds;
  figures.peakResident = peakResident();
  QuietErrors const quiet;
  figures.heldByChannels = ChannelPool::allocatedMemory();
  figures.heldByArrays = ArrayPool::allocatedMemory();
  figures.heldByBlocks = ChannelMemoryPool::freeStoreAvailableMemory();
  return figures;
}

} // namespace Vln
