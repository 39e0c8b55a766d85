#include "GeometryVolume/nanovtt/VTTToNanoVTT.h"

#include "GeometryVolume/nanovtt/ConversionImpl.h"

#include <algorithm>
#include <type_traits>

namespace nanovtt {

namespace {

template <class BuildT> constexpr Internal::Build buildOf() {
  using Internal::Build;
  if constexpr (std::is_same_v<BuildT, nanovdb::Fp4>)
    return Build::kFp4;
  else if constexpr (std::is_same_v<BuildT, nanovdb::Fp8>)
    return Build::kFp8;
  else if constexpr (std::is_same_v<BuildT, nanovdb::Fp16>)
    return Build::kFp16;
  else if constexpr (std::is_same_v<BuildT, nanovdb::FpN>)
    return Build::kFpN;
  else
    return Build::kPlain;
}

} // namespace

template <class BufferT, class BuildT, class OracleT, bool kEnableCoalescedTilesSupportT>
GridHandle<BufferT>
vttToNanoVTT(VLN::Object const& object, Ostil::String const& channelFilter, nanovdb::StatsMode,
             nanovdb::ChecksumMode checksumMode, int verbosity, float tolerance, bool enableDithering,
             float haloOptFraction, int rootLevelLimit, int finestLevel, bool sortTilesInMortonOrder,
             bool coalesceTileData, bool cubicBufferSize, int bufferElementBytes,
             bool storeTileDataAs3DTextures, bool fogThresholdFix, float coarserTolerance,
             bool setCoarserLevels, bool enableNanoVTTTraversal, BufferT* out_traversalStructure,
             BufferT* out_neighborStructure, Velorn::Math::bbox<Velorn::Math::float3, float>* out_bbox,
             BufferT const& pool) {
  Internal::ConversionSettings settings;
  settings.build = buildOf<BuildT>();
  settings.coalescingBuiltIn = kEnableCoalescedTilesSupportT;
  settings.checksumMode = static_cast<std::uint32_t>(checksumMode);
  settings.log = verbosity > 0;
  settings.tolerance = tolerance;
  settings.dither = enableDithering;
  settings.haloFraction = haloOptFraction > 0 ? std::min(haloOptFraction, 1.0f) : 0.0f; // NaN: none
  settings.rootLevelLimit = rootLevelLimit;
  settings.finestLevel = finestLevel;
  settings.morton = sortTilesInMortonOrder;
  settings.coalesce = coalesceTileData;
  settings.cubic = cubicBufferSize;
  settings.elementBytes = static_cast<std::uint64_t>(std::max(bufferElementBytes, 1));
  settings.textures = storeTileDataAs3DTextures;
  settings.fogFix = fogThresholdFix;
  settings.coarserTolerance = coarserTolerance;
  settings.coarserLevels = setCoarserLevels;
  settings.traversal = enableNanoVTTTraversal;
  Internal::applyOptionRules(settings, {out_traversalStructure != nullptr, out_neighborStructure != nullptr});

  BufferT main;
  auto const makeBuffer = [&](Internal::BufferRole role, std::uint64_t size) {
    BufferT buffer = BufferT::createAligned(size, &pool);
    std::uint8_t* const bytes = buffer.data();
    switch (role) {
    case Internal::BufferRole::kTraversal:
      *out_traversalStructure = std::move(buffer);
      break;
    case Internal::BufferRole::kNeighbors:
      *out_neighborStructure = std::move(buffer);
      break;
    case Internal::BufferRole::kMain:
      main = std::move(buffer);
      break;
    }
    return bytes;
  };
  if (!Internal::convert(object, channelFilter, settings, makeBuffer, out_bbox)) return {};
  return GridHandle<BufferT>(std::move(main));
}

#define NANOVTT_CONVERSION(BufferT, BuildT, kCoalesced)                                                      \
  template VLN_API GridHandle<BufferT> vttToNanoVTT<BufferT, BuildT, nanovdb::AbsDiff, kCoalesced>(          \
      VLN::Object const&, Ostil::String const&, nanovdb::StatsMode, nanovdb::ChecksumMode, int, float, bool, \
      float, int, int, bool, bool, bool, int, bool, bool, float, bool, bool, BufferT*, BufferT*,             \
      Velorn::Math::bbox<Velorn::Math::float3, float>*, BufferT const&);
#define NANOVTT_BUILDS(BufferT, kCoalesced)                                                                  \
  NANOVTT_CONVERSION(BufferT, nanovdb::Fp4, kCoalesced)                                                      \
  NANOVTT_CONVERSION(BufferT, nanovdb::Fp8, kCoalesced)                                                      \
  NANOVTT_CONVERSION(BufferT, nanovdb::Fp16, kCoalesced)                                                     \
  NANOVTT_CONVERSION(BufferT, nanovdb::FpN, kCoalesced)                                                      \
  NANOVTT_CONVERSION(BufferT, void, kCoalesced)

NANOVTT_BUILDS(AlignedHostBuffer, true)
NANOVTT_BUILDS(AlignedHostBuffer, false)
NANOVTT_BUILDS(CopyableCudaDeviceBuffer, true)
NANOVTT_BUILDS(CopyableCudaDeviceBuffer, false)

} // namespace nanovtt
