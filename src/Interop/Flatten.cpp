#include "Interop/Flatten.h"

#include "GeometryVolume/channels/Channel.h"
#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/nanovtt/VTTToNanoVTT.h"
#include "GeometryVolume/tiletree/Container.h"
#include "GeometryVolume/utils/ChannelParser.h"
#include "Interop/FileError.h"
#include "Reader/NanoVTTReader.h"

#include <algorithm>
#include <chrono>
#include <cmath>
#include <stdexcept>
#include <typeindex>

namespace VLN::Interop {

namespace {

using Traits = TileTree3D::PowerOfTwoTraits;
using Tree = TileTree3D::Container<Traits>;

Utils::ChannelParser parserOf(std::string const& filter) {
  Utils::ChannelParser parser;
  auto const status = parser.parses(filter);
  if (!status)
    throw std::runtime_error("'" + oneLine(filter, 60) + "' is no filter of channels: " + status.message);
  return parser;
}

/// The depth of all roots.
int rootDepthOf(Tree const& tree) {
  int depth = -1;
  for (auto root = tree.cbeginRoots(); root != tree.cendRoots(); ++root) {
    int const d = root->second.depth;
    if (depth >= 0 && d != depth) throw std::runtime_error("its roots lie at several depths");
    depth = d;
  }
  return depth;
}

void checkOptions(FlattenOptions const& o) {
  bool const quantised = o.quantisation != Quantisation::kNone;
  if (o.textures && (quantised || o.coalesce || !(o.haloFraction >= 1)))
    throw std::runtime_error("textures need halos for all tiles, and neither codes nor merged tiles");
  if (o.coalesce && quantised) throw std::runtime_error("tiles with codes cannot be merged");
  if (o.coalesce && (o.traversal || o.neighbors))
    throw std::runtime_error("merged tiles have no structures of traversal or neighbours");
  if (o.coarserLevels && o.quantisation == Quantisation::kFpN)
    throw std::runtime_error("coarser levels cannot be set with codes of varying width");
}

template <class BuildT> FlatVolume convert(Object const& object, FlattenOptions const& o, int rootLevel) {
  using Buffer = nanovtt::AlignedHostBuffer;
  FlatVolume flat;
  Buffer const pool;
  auto const start = std::chrono::steady_clock::now();
  auto handle = nanovtt::vttToNanoVTT<Buffer, BuildT, nanovdb::AbsDiff, true>(
      object, o.channels, nanovdb::StatsMode(0), nanovdb::ChecksumMode(o.checksum), o.log ? 1 : 0,
      o.tolerance, o.dither, o.haloFraction, rootLevel, o.finestLevel, o.morton, o.coalesce, o.cubic,
      o.elementBytes, o.textures, false, o.coarserTolerance, o.coarserLevels, o.traversal,
      o.traversal ? &flat.traversal : nullptr, o.neighbors ? &flat.neighbors : nullptr, nullptr, pool);
  flat.seconds = std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
  flat.buffer = std::move(handle.buffer());
  return flat;
}

} // namespace

std::vector<std::string> flatChannels(Object const& object, std::string const& filter) {
  auto const parser = parserOf(filter);
  std::type_index const types[] = {typeid(float),
                                   typeid(double),
                                   typeid(short),
                                   typeid(int),
                                   typeid(std::int64_t),
                                   typeid(Velorn::Math::float3),
                                   typeid(Velorn::Math::double3),
                                   typeid(unsigned int),
                                   typeid(Velorn::Math::float4)};
  std::vector<std::string> names;
  for (auto const& name : object.componentRange()) {
    auto const channel = object.component<TileTree3D::ChannelBase>(name);
    if (!channel || !parser.accepts(name)) continue;
    auto const layout = channel->layout();
    if (layout.core != Traits::kTDW || layout.halo != 0) continue;
    for (auto const& type : types)
      if (channel->elementType() == type) names.push_back(name);
  }
  return names;
}

FlatVolume flattenVolume(Object const& object, FlattenOptions const& options) {
  checkOptions(options);
  if (flatChannels(object, options.channels).empty())
    throw std::runtime_error("no channel that a flat buffer can hold passes the filter '" +
                             oneLine(options.channels, 60) + "'");
  auto const tree = object.component<Tree>("voxel_tile_tree");
  if (!tree || !object.hasComponentFromName("voxel_component"))
    throw std::runtime_error("it is no volume of voxels");
  int const rootDepth = rootDepthOf(*tree);
  int const rootLevel = rootDepth < 0 ? 0 : Traits::kMaxDepth - rootDepth;
  if (options.finestLevel > rootLevel)
    throw std::runtime_error("the finest level lies above the roots, which are at level " +
                             std::to_string(rootLevel));
  FlatVolume flat;
  switch (options.quantisation) {
  case Quantisation::kNone:
    flat = convert<void>(object, options, rootLevel);
    break;
  case Quantisation::kFp4:
    flat = convert<nanovdb::Fp4>(object, options, rootLevel);
    break;
  case Quantisation::kFp8:
    flat = convert<nanovdb::Fp8>(object, options, rootLevel);
    break;
  case Quantisation::kFp16:
    flat = convert<nanovdb::Fp16>(object, options, rootLevel);
    break;
  case Quantisation::kFpN:
    flat = convert<nanovdb::FpN>(object, options, rootLevel);
    break;
  }
  if (flat.buffer.empty()) throw std::runtime_error("its roots do not fit a root table");
  return flat;
}

std::vector<FlatError> flatErrors(Object const& object, FlatVolume const& flat) {
  using FloatChannel = TileTree3D::Channel<Traits, float, 4, 0>;
  struct Sum {
    double largest = 0, total = 0;
    std::uint64_t count = 0;
  };
  nanovtt::BufferReader const reader(flat.buffer.data());
  auto const tree = object.component<Tree>("voxel_tile_tree");
  std::vector<FlatError> errors;
  for (std::uint32_t n = 0; n < reader.gridCount(); ++n) {
    auto const grid = reader.grid(n);
    auto const channel = object.component<FloatChannel>(grid.name());
    if (!channel) continue;
    Sum all;
    for (int d = reader.container().rootDepth(); d <= Traits::kMaxDepth; ++d) {
      if (reader.container().tileCount(d) == 0) continue;
      all = parallelReduce(
          0, tree->tileCount(d), 1024, all,
          [&](std::int64_t begin, std::int64_t end) {
            Sum part;
            for (std::int64_t i = begin; i < end; ++i) {
              auto const& tile = tree->tile(i, d);
              if (!tile.valid()) continue;
              auto const at = reader.container().find(tile.ti(), tile.tj(), tile.tk(), d);
              if (at.depth != d) continue; // inside a block
              auto const block = grid.block(at.number);
              auto const samples = channel->tileData(tile.treeIndex());
              for (int s = 0; s < FloatChannel::kSize; ++s) {
                double const difference = std::abs(
                    double(block.getFloat(block.index(s % 4, s / 4 % 4, s / 16))) - double(samples[s]));
                if (difference > part.largest) part.largest = difference;
                if (std::isfinite(difference)) part.total += difference;
                ++part.count;
              }
            }
            return part;
          },
          [](Sum a, Sum const& b) {
            return Sum{std::max(a.largest, b.largest), a.total + b.total, a.count + b.count};
          });
    }
    errors.push_back({grid.name(), all.largest, all.count ? all.total / double(all.count) : 0});
  }
  return errors;
}

} // namespace VLN::Interop
