// Random volumes for the flat buffer's tests, and a call of the conversion by named options.
#pragma once

#include "GeometryVolume/channels/Channel.h"
#include "GeometryVolume/channels/ElementTraits.h"
#include "GeometryVolume/core/ElementTypes.h"
#include "GeometryVolume/nanovtt/AlignedHostBuffer.h"
#include "GeometryVolume/nanovtt/VTTToNanoVTT.h"
#include "GeometryVolume/tiletree/TileAccessor.h"
#include "GeometryVolume/topology/Command.h"

#include <algorithm>
#include <cmath>
#include <random>
#include <sstream>
#include <string>
#include <type_traits>

/// FLAT_FOR_EACH_TYPE(X) expands X(type) for each element type that a flat buffer holds and that this build
/// has, in the order of the grids.
#if VLN_HAS_ELEMENT_FLOAT
#define FLAT_FLOAT(X) X(float)
#else
#define FLAT_FLOAT(X)
#endif
#if VLN_HAS_ELEMENT_DOUBLE
#define FLAT_DOUBLE(X) X(double)
#else
#define FLAT_DOUBLE(X)
#endif
#if VLN_HAS_ELEMENT_INT16
#define FLAT_INT16(X) X(std::int16_t)
#else
#define FLAT_INT16(X)
#endif
#if VLN_HAS_ELEMENT_INT32
#define FLAT_INT32(X) X(std::int32_t)
#else
#define FLAT_INT32(X)
#endif
#if VLN_HAS_ELEMENT_INT64
#define FLAT_INT64(X) X(std::int64_t)
#else
#define FLAT_INT64(X)
#endif
#if VLN_HAS_ELEMENT_FLOAT3
#define FLAT_FLOAT3(X) X(Velorn::Math::float3)
#else
#define FLAT_FLOAT3(X)
#endif
#if VLN_HAS_ELEMENT_DOUBLE3
#define FLAT_DOUBLE3(X) X(Velorn::Math::double3)
#else
#define FLAT_DOUBLE3(X)
#endif
#if VLN_HAS_ELEMENT_UINT32
#define FLAT_UINT32(X) X(std::uint32_t)
#else
#define FLAT_UINT32(X)
#endif
#if VLN_HAS_ELEMENT_FLOAT4
#define FLAT_FLOAT4(X) X(Velorn::Math::float4)
#else
#define FLAT_FLOAT4(X)
#endif
#define FLAT_FOR_EACH_TYPE(X)                                                                                \
  FLAT_FLOAT(X)                                                                                              \
  FLAT_DOUBLE(X)                                                                                             \
  FLAT_INT16(X) FLAT_INT32(X) FLAT_INT64(X) FLAT_FLOAT3(X) FLAT_DOUBLE3(X) FLAT_UINT32(X) FLAT_FLOAT4(X)

namespace Support {

using Velorn::Math::int3;
using FlatTraits = VLN::TileTree3D::PowerOfTwoTraits;
using FlatTree = VLN::TileTree3D::Container<FlatTraits>;
using FlatTopology = VLN::TileTree3D::VoxelTopology<FlatTraits>;
template <class T> using FlatChannel = VLN::TileTree3D::Channel<FlatTraits, T, 4, 0>;

struct FlatOptions {
  std::string filter = "*";
  nanovdb::ChecksumMode checksum = nanovdb::ChecksumMode(0);
  int verbosity = 0;
  float tolerance = -1;
  bool dither = false;
  float haloFraction = 0;
  int rootLevelLimit = 0, finestLevel = 0;
  bool morton = false, coalesce = false, cubic = false;
  int elementBytes = 4;
  bool textures = false, fogFix = false;
  float coarserTolerance = 0;
  bool setCoarser = false, traversal = false;

  int maxDepth() const { return 28 - std::clamp(finestLevel, 0, 28); }
  std::string text() const {
    std::ostringstream os;
    os << "filter '" << filter << "' checksum " << static_cast<int>(checksum) << " tolerance " << tolerance
       << " dither " << dither << " halo " << haloFraction << " rootLevelLimit " << rootLevelLimit
       << " finestLevel " << finestLevel << " morton " << morton << " coalesce " << coalesce << " cubic "
       << cubic << " elementBytes " << elementBytes << " textures " << textures << " fogFix " << fogFix
       << " coarserTolerance " << coarserTolerance << " setCoarser " << setCoarser;
    return os.str();
  }
};

template <class BuildT = void, class BufferT = nanovtt::AlignedHostBuffer, bool kCoalesce = true>
nanovtt::GridHandle<BufferT> flatten(VLN::Object const& object, FlatOptions const& o,
                                     BufferT* traversal = nullptr, BufferT* neighbors = nullptr,
                                     Velorn::Math::bbox<Velorn::Math::float3, float>* box = nullptr,
                                     BufferT const& pool = BufferT()) {
  return nanovtt::vttToNanoVTT<BufferT, BuildT, nanovdb::AbsDiff, kCoalesce>(
      object, o.filter, nanovdb::StatsMode(0), o.checksum, o.verbosity, o.tolerance, o.dither, o.haloFraction,
      o.rootLevelLimit, o.finestLevel, o.morton, o.coalesce, o.cubic, o.elementBytes, o.textures, o.fogFix,
      o.coarserTolerance, o.setCoarser, o.traversal, traversal, neighbors, box, pool);
}

/// A tree that is filled by hand, then put into an object with its topology; channels follow.
class FlatVolume {
public:
  explicit FlatVolume(float voxelSize = 0.25f)
      : tree("voxel_tile_tree", voxelSize) {}
  /// One that is there.
  explicit FlatVolume(Ostil::Ptr<VLN::Object> made)
      : tree(*made->component<FlatTree>("voxel_tile_tree"))
      , object(Ostil::MutablePtr<VLN::Object>::shareWith(std::move(made))) {}

  void add(int3 const& p, int depth) { tree.tileAccessor().addTile(p, depth); }
  /// The tile and its ancestors down from a depth.
  void add(int3 const& p, int from, int depth) {
    auto accessor = tree.tileAccessor();
    for (int d = from; d <= depth; ++d) accessor.addTile(p, d);
  }
  /// All tiles of `levels` depths below the tile that holds the point.
  void complete(int3 const& p, int depth, int levels) {
    auto accessor = tree.tileAccessor();
    accessor.addTile(p, depth);
    if (!levels || depth == 28) return;
    int const w = FlatTraits::width(depth), half = w / 2;
    int3 const corner{FlatTraits::align(p.x, depth), FlatTraits::align(p.y, depth),
                      FlatTraits::align(p.z, depth)};
    for (int n = 0; n < 8; ++n)
      complete({corner.x + (n & 1) * half, corner.y + (n >> 1 & 1) * half, corner.z + (n >> 2) * half},
               depth + 1, levels - 1);
  }

  /// The tree is done: makes the object.
  void finish() {
    object = VLN::createEmptyVLN();
    Ostil::Ptr<VLN::Component> copy;
    tree.copyTo(copy);
    object->addComponent(copy);
    VLN::TileTree3D::Command::createVoxelTopology<2, 4, 0>("voxel_component", tree, *object,
                                                           VLN::TileTree3D::kVoxelOffsetCorner);
  }
  /// Fills each tile's samples by f(tile, k), k being the sample's number.
  template <class T, class F>
  void channel(std::string const& name, T const& defaultValue, F const& f, int minDepth = 0,
               int maxDepth = 28) {
    auto const topology = object->component<FlatTopology>("voxel_component");
    auto made = Ostil::makeMutable<FlatChannel<T>>(
        name, &defaultValue, VLN::TileTree3D::kInitializeDefaultValue, false, true, minDepth, maxDepth);
    made->setTargetName("voxel_component");
    made->update(*topology);
    for (int d = made->minDepth(); d <= made->depth(); ++d)
      for (std::int64_t n = 0; n < tree.tileCount(d); ++n) {
        auto data = made->tileData(n, d);
        for (int k = 0; k < 64; ++k) data[k] = f(std::as_const(tree).tile(n, d), k);
      }
    object->putComponent(std::move(made));
  }

  FlatTree tree;
  Ostil::MutablePtr<VLN::Object> object;
  /// The depth that most roots of a random forest have.
  int top = 0;
};

/// A number in -10..10, of few digits, so that equal values occur.
template <class T> T flatValue(std::mt19937& random) {
  using Traits = VLN::TileTree3D::ElementTraits<T>;
  T value{};
  for (int c = 0; c < Traits::kComponents; ++c) {
    int const n = static_cast<int>(random() % 2001) - 1000;
    Traits::component(value, c) =
        static_cast<typename Traits::Scalar>(std::is_integral_v<typename Traits::Scalar> ? n : n / 100.0);
  }
  return value;
}

/// A forest of mixed depths in a region that a root table can span, and channels of all types.
inline void fillRandom(FlatVolume& volume, std::uint32_t seed, int maxTiles = 400) {
  std::mt19937 random(seed);
  auto const pick = [&](int low, int high) { return std::uniform_int_distribution<int>(low, high)(random); };
  int const top = volume.top = pick(0, 3) == 0 ? pick(0, 5) : pick(6, 26);
  std::int64_t const w = FlatTraits::width(top);
  // The region's first tile: now and then at an end of the domain.
  std::int64_t const across = std::int64_t(1) << top;
  std::int64_t const span = std::min<std::int64_t>(across, pick(0, 3) ? 6 : 60);
  int3 first;
  for (int a = 0; a < 3; ++a) {
    std::int64_t const room = across - span;
    std::int64_t const at = pick(0, 5) == 0   ? 0
                            : pick(0, 4) == 0 ? room
                                              : static_cast<std::int64_t>(random()) % (room + 1);
    first[a] = static_cast<int>(FlatTraits::kMinTileCoord + at * w);
  }
  if (top >= 2 && pick(0, 4) == 0) volume.add(first, top - pick(1, 2));
  int const bottom = std::min(28, top + pick(0, 6));
  for (int n = 0; n < maxTiles && volume.tree.tileCount(-1) < maxTiles; ++n) {
    int3 p;
    bool const clustered = pick(0, 3) != 0;
    for (int a = 0; a < 3; ++a) {
      std::int64_t const reach = (clustered ? std::min<std::int64_t>(span, 2) : span) * w;
      p[a] =
          static_cast<int>(first[a] + static_cast<std::int64_t>((std::uint64_t(random()) << 20 ^ random()) %
                                                                static_cast<std::uint64_t>(reach)));
    }
    int const kind = pick(0, 9);
    int const depth = pick(top, bottom);
    if (kind < 7)
      volume.add(p, top, depth);
    else
      volume.add(p, top, std::max(top, depth - 2)),
          volume.complete(p, std::max(top, depth - 2),
                          std::min(pick(1, 3), bottom - std::max(top, depth - 2)));
  }
  volume.finish();
  int n = 0;
#define FLAT_ADD(type)                                                                                       \
  {                                                                                                          \
    auto const value = flatValue<type>(random);                                                              \
    int const low = pick(0, 4) ? 0 : std::min(28, top + pick(0, 1)),                                         \
              high = pick(0, 2) ? 28 : pick(top, bottom);                                                    \
    volume.channel<type>(                                                                                    \
        "c" + std::to_string(n++), value,                                                                    \
        [&](auto const&, int) { return random() % 4 ? flatValue<type>(random) : value; }, low,               \
        std::max(low, high));                                                                                \
  }
  FLAT_FOR_EACH_TYPE(FLAT_ADD)
#undef FLAT_ADD
}

} // namespace Support
