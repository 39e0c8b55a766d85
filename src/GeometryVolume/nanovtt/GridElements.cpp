#include "GeometryVolume/nanovtt/GridElementsImpl.h"

#include "GeometryVolume/channels/Channel.h"
#include "GeometryVolume/channels/ElementTraits.h"
#include "GeometryVolume/channels/NonLeafValues.h"
#include "GeometryVolume/channels/UntypedTilesImpl.h"
#include "GeometryVolume/core/ElementTypes.h"
#include "GeometryVolume/nanovtt/GridVisitorImpl.h"
#include "GeometryVolume/pools/ChannelPool.h"

#include <algorithm>
#include <cmath>
#include <cstring>
#include <mutex>

namespace nanovdb {
template <class T> class Vec3;
template <class T> class Vec4;
} // namespace nanovdb

namespace nanovtt {

using Velorn::Math::double3;
using Velorn::Math::float3;
using Velorn::Math::float4;
using VLN::TileTree3D::ElementTraits;

// --- What a visitor needs its element type for ---

namespace Internal {

namespace {

/// A row of four samples of a tile.
using Row = float __attribute__((vector_size(16)));

/// Bits of the 64 core samples, i fastest, that pass a test of whole rows.
template <class Test> std::uint64_t maskOfRows(float const* samples, int width, Test const& test) {
  using Bits = std::int32_t __attribute__((vector_size(16)));
  Bits rows{}; // bit n of lane i: sample i of row n
  for (int n = 0; n < 16; ++n) {
    Row row;
    std::memcpy(&row, samples + (n / 4 * width + n % 4) * width, sizeof row);
    rows |= test(row) & (1 << n);
  }
  std::uint64_t mask = 0;
  for (int i = 0; i < 4; ++i) {
    auto x = static_cast<std::uint64_t>(static_cast<std::uint32_t>(rows[i]));
    x = (x | x << 24) & 0x000000FF000000FFull; // three zeros between the bits, in four halvings
    x = (x | x << 12) & 0x000F000F000F000Full;
    x = (x | x << 6) & 0x0303030303030303ull;
    x = (x | x << 3) & 0x1111111111111111ull;
    mask |= x << i;
  }
  return mask;
}

} // namespace

} // namespace Internal

#define NANOVTT_VISITOR                                                                                      \
  template <class BuildT, class ValueT, class ElementT, class ConstTile, class WorkTile, int kElementBytes>
#define NANOVTT_VISITOR_OF Visitor<BuildT, ValueT, ElementT, ConstTile, WorkTile, kElementBytes>

NANOVTT_VISITOR std::uint64_t NANOVTT_VISITOR_OF::active(Internal::StoredTile const& tile,
                                                         float threshold) const {
  auto const* const samples = static_cast<ElementT const*>(tile.samples);
  auto const defaultValue = *static_cast<ElementT const*>(task().source.defaultValue);
  if constexpr (std::is_same_v<ElementT, float>) {
    using Internal::Row;
    if (task().isLevelSet() && threshold == 0)
      return Internal::maskOfRows(samples, tile.width, [](Row const& v) { return v < 0; });
    return Internal::maskOfRows(samples, tile.width, [&](Row const& v) {
      Row const difference = defaultValue - v;
      return (difference > threshold) | (-difference > threshold);
    });
  } else {
    std::uint64_t mask = 0;
    for (int k = 0, bit = 0; k < kTileWidth; ++k)
      for (int j = 0; j < kTileWidth; ++j)
        for (int i = 0; i < kTileWidth; ++i, ++bit) {
          ElementT const& v = samples[(k * tile.width + j) * tile.width + i];
          bool const on = ElementTraits<ElementT>::distance(defaultValue, v) > double(threshold);
          mask |= std::uint64_t(on) << bit;
        }
    return mask;
  }
}

NANOVTT_VISITOR void NANOVTT_VISITOR_OF::quantise(Internal::StoredTile const& tile,
                                                  [[maybe_unused]] std::uint32_t number,
                                                  std::uint8_t* out) const {
  if constexpr (std::is_same_v<ElementT, float> && !std::is_void_v<BuildT>) {
    auto const* const samples = static_cast<float const*>(tile.samples);
    int const count = tile.width * tile.width * tile.width;
    if constexpr (std::is_same_v<BuildT, nanovdb::FpN>)
      Internal::writeFpN(task().records[number], samples, count, task().dither, out);
    else
      Internal::writeQuantised(task().settings.build, samples, count, task().dither, out);
  }
}

namespace Internal {

namespace {

template <class T> using ChannelOf = VLN::TileTree3D::Channel<Traits, T, 4, 0>;

/// What NanoVDB calls the values of a type.
template <class T> struct GridValue { using type = T; };
template <> struct GridValue<float3> { using type = nanovdb::Vec3<float>; };
template <> struct GridValue<double3> { using type = nanovdb::Vec3<double>; };
template <> struct GridValue<float4> { using type = nanovdb::Vec4<float>; };

template <class T> Ostil::Ptr<ChannelBase> find(VLN::Object const& object, Ostil::String const& name) {
  return object.component<ChannelOf<T>>(name);
}

template <class T> ChannelOf<T> const& typed(ChannelBase const& channel) {
  return static_cast<ChannelOf<T> const&>(channel);
}

template <class T> VLN::TileTree3D::Internal::UntypedTiles tiles(ChannelBase const& channel) {
  return VLN::TileTree3D::Internal::untypedTiles<T>(typed<T>(channel));
}

template <class T>
bool coarserDiffer(ChannelBase const& channel, Tree const& tree, VLN::TileTree3D::VoxelOffsetType offset,
                   float tolerance, int firstDepth) {
  return VLN::TileTree3D::checkIfNonLeafValueIsSetToChildValue(typed<T>(channel), tree, offset, tolerance,
                                                               firstDepth, kMaxDepth);
}

template <class T>
Ostil::Ptr<ChannelBase> withCoarser(ChannelBase const& channel, Tree const& tree,
                                    VLN::TileTree3D::VoxelOffsetType offset, int firstDepth) {
  using namespace VLN::TileTree3D;
  ChannelOf<T> const& source = typed<T>(channel);
  T const defaultValue = source.defaultValue();
  Ostil::Ptr<ChannelOf<T>> copy;
  if (ChannelPool::enabled())
    copy =
        ChannelPool::allocate<Traits, T, 4, 0>(defaultValue, false, true, source.minDepth(), source.depth(),
                                               static_cast<std::uint64_t>(tree.tileCount(-1)), nullptr);
  if (!copy)
    copy = Ostil::makePtr<ChannelOf<T>>(source.name(), &defaultValue, kInitializeDefaultValue, false, true,
                                        source.minDepth(), source.depth());
  VLN::PerDepth<std::int64_t, kChannelDepths> counts;
  for (int d = 0; d < kChannelDepths; ++d) counts[d] = tree.tileCount(d);
  copy->resize(counts.data(), kTileSamples);

  auto const from = VLN::TileTree3D::Internal::untypedTiles<T>(source);
  auto const storage = copy->cloneData();
  for (int d = std::max(source.minDepth(), 0); d <= std::min(source.depth(), kMaxDepth); ++d) {
    auto& to = (*storage)[d];
    VLN::parallelFor(0, static_cast<std::int64_t>(to.size()),
                     [&](std::int64_t begin, std::int64_t end) {
                       for (std::int64_t n = begin; n < end; ++n) {
                         auto& tile = to[n];
                         auto const* const samples = static_cast<T const*>(from.elements({n, d}));
                         if (tile.size() != std::size_t(kTileSamples))
                           tile.resize(kTileSamples, defaultValue);
                         if (samples) std::copy_n(samples, kTileSamples, tile.data());
                       }
                     },
                     {.grain = 64});
  }
  setNonLeafValueToChildValue(*copy, tree, offset, firstDepth, copy->depth());
  return copy;
}

template <class T> void fixFog(void const* samples, float threshold, void* out) {
  constexpr int w = kHaloTileWidth;
  constexpr int stride[3] = {1, w, w * w};
  auto const* const from = static_cast<T const*>(samples);
  for (int n = 0; n < kHaloTileSamples; ++n) {
    bool raised = false;
    for (int a = 0; from[n] <= threshold && a < 3 && !raised; ++a) {
      int const at = n / stride[a] % w;
      raised = (at > 0 && from[n - stride[a]] > threshold) || (at + 1 < w && from[n + stride[a]] > threshold);
    }
    static_cast<T*>(out)[n] = raised ? T(threshold + 1.1920929e-7f) : from[n];
  }
}

template <class BuildT, class T, class ValueT> ActiveBoxes fillAs(GridTask const& task) {
  using VLN::TileTree3D::ConstTileData;
  using VLN::TileTree3D::TileData;
  using TileVisitor =
      nanovtt::Visitor<BuildT, ValueT, T, ConstTileData<T, 4, 0>, TileData<T, 5, 0>, int(sizeof(T))>;
  constexpr std::int64_t kTilesAtOnce = 256;
  ActiveBoxes boxes;
  std::mutex mutex;
  for (int d = task.layout.rootDepth(); d <= task.layout.maxDepth(); ++d)
    VLN::parallelFor(0, task.layout.tree().tileCount(d),
                     [&](std::int64_t begin, std::int64_t end) {
                       TileVisitor visitor(task);
                       {
                         // What is in the boxes already needs no look at its samples.
                         std::lock_guard const lock(mutex);
                         visitor.startFrom(boxes);
                       }
                       visitor.visit(d, begin, end);
                       std::lock_guard const lock(mutex);
                       boxes.join(visitor.boxes());
                     },
                     {.grain = kTilesAtOnce});
  return boxes;
}

template <class T> ActiveBoxes fill(GridTask const& task) {
  constexpr bool quantised = std::is_same_v<T, float>;
  using Value = typename GridValue<T>::type;
  switch (task.settings.build) {
  case Build::kFp4:
    return fillAs<nanovdb::Fp4, T, std::conditional_t<quantised, nanovdb::Fp4, Value>>(task);
  case Build::kFp8:
    return fillAs<nanovdb::Fp8, T, std::conditional_t<quantised, nanovdb::Fp8, Value>>(task);
  case Build::kFp16:
    return fillAs<nanovdb::Fp16, T, std::conditional_t<quantised, nanovdb::Fp16, Value>>(task);
  case Build::kFpN:
    return fillAs<nanovdb::FpN, T, std::conditional_t<quantised, nanovdb::FpN, Value>>(task);
  case Build::kPlain:
    break;
  }
  return fillAs<void, T, Value>(task);
}

template <class T> constexpr GridElement elementOf() {
  auto const& known = VLN::TileTree3D::kElementType<T>;
  FogFix fog = nullptr;
  if constexpr (std::is_floating_point_v<T>) fog = &fixFog<T>;
  return {known.name,        GridType(known.flatId), &find<T>, &tiles<T>,
          &coarserDiffer<T>, &withCoarser<T>,        fog,      &fill<T>};
}

} // namespace

std::span<GridElement const> gridElements() {
  // The order is that of the grids in a buffer.
#define VLN_ELEMENT(type, name) elementOf<type>(),
  static constexpr GridElement kElements[] = {VLN_FOR_EACH_FLAT_ELEMENT_TYPE(VLN_ELEMENT)};
#undef VLN_ELEMENT
  return kElements;
}

void planFpNTiles(GridTask& task) {
  ContainerLayout const& layout = task.layout;
  task.records.assign(layout.tileCount(), {});
  for (int d = layout.rootDepth(); d <= layout.maxDepth(); ++d) {
    VLN::parallelFor(0, layout.tree().tileCount(d),
                     [&](std::int64_t begin, std::int64_t end) {
                       auto const accessor = layout.tree().tileAccessor();
                       TileSamples samples(task, accessor);
                       for (std::int64_t n = begin; n < end; ++n) {
                         TileType const& tile = layout.tree().tile(n, d);
                         if (!tile.valid()) continue;
                         std::uint32_t const number = layout.number(d, n);
                         StoredTile const stored = samples.get(tile, layout.hasHalo(number));
                         task.records[number] =
                             planFpN(static_cast<float const*>(stored.samples),
                                     stored.width * stored.width * stored.width, task.tolerance, task.dither);
                       }
                     },
                     {.grain = 64});
  }
  task.offsets.resize(task.records.size() + 1);
  task.offsets[0] = task.tableBytes();
  for (std::size_t n = 0; n < task.records.size(); ++n)
    task.offsets[n + 1] = task.offsets[n] + kFpNRecordBytes + task.records[n].payload;
}

} // namespace Internal

} // namespace nanovtt
