#include "GeometryVolume/nanovtt/ConversionSettingsImpl.h"

#include <algorithm>
#include <cmath>
#include <cstring>

namespace nanovtt::Internal {

int ConversionSettings::maxDepth() const {
  return Traits::kMaxDepth - std::clamp(finestLevel, 0, Traits::kMaxDepth);
}

namespace {

void warn(char const* text) { std::cerr << "VTTToNanoVTT: " << text << '\n'; }

} // namespace

void applyOptionRules(ConversionSettings& s, OptionRequest const& request) {
  bool const mayCoalesce = !s.quantised();
  if (s.traversal && (!request.traversalBuffer || (mayCoalesce && s.coalesce))) {
    s.traversal = false;
    warn("enableNanoVTTTraversal disabled. Requirements: out_traversalStructure != nullptr and "
         "coalesceTileData == false.");
  }
  char const* const noTextures = "storeTileDataAs3DTextures disabled. Requirements: currently not supported "
                                 "with quantization nor tile data coalescing.";
  if (!s.quantised()) {
    if (s.textures && (s.coalesce || !(s.haloFraction >= 1.0f))) {
      s.textures = false;
      warn(noTextures);
    }
    s.neighbors = request.neighborBuffer && !s.coalesce;
    if (request.neighborBuffer && !s.neighbors)
      warn("enableNanoVTTNeighbors disabled. Requirements: out_neighborStructure != nullptr and "
           "coalesceTileData == false.");
    if (s.coalesce) {
      char const* const word = s.coalescingBuiltIn ? "ON" : "OFF";
      Log(s.log).line("coalesceTileData=ON, NANOVTT_SUPPORT_COALESCED_TILES=", word,
                      ", kEnableCoalescedTilesSupportT = ", word);
    }
    s.coalesce = s.coalesce && s.coalescingBuiltIn;
  } else {
    if (s.coalesce) {
      s.coalesce = false;
      warn("coalesceTileData disabled. Requirements: currently not supported with quantization.");
    }
    if (s.textures) {
      s.textures = false;
      warn(noTextures);
    }
    s.neighbors = request.neighborBuffer;
  }
  if (s.build == Build::kFpN && s.coarserLevels) {
    s.coarserLevels = false;
    warn("setCoarserLevels disabled. Requirements: VoxelT != nanovdb::FpN.");
  }
}

std::uint64_t cubeRootUp(std::uint64_t n) {
  auto const cube = [](std::uint64_t s) { return static_cast<VLN::TileTree3D::DoubleWord>(s) * s * s; };
  auto s = static_cast<std::uint64_t>(std::cbrt(static_cast<double>(n)));
  while (s > 0 && cube(s - 1) >= n) --s;
  while (cube(s) < n) ++s;
  return s;
}

std::uint64_t cubicSize(std::uint64_t size, std::uint64_t elementBytes) {
  std::uint64_t const s = cubeRootUp(size / elementBytes + (size % elementBytes != 0));
  return elementBytes * s * s * s;
}

std::uint64_t blockSize(std::uint64_t size, std::uint64_t elementBytes) {
  std::uint64_t const unit = elementBytes * 16384;
  return (size + unit - 1) / unit * unit;
}

void fillZeros(std::uint8_t* first, std::uint64_t size) {
  constexpr std::int64_t kPiece = 1 << 20;
  VLN::parallelFor(0, static_cast<std::int64_t>((size + kPiece - 1) / kPiece),
                   [&](std::int64_t begin, std::int64_t end) {
                     std::uint64_t const from = static_cast<std::uint64_t>(begin) * kPiece;
                     std::uint64_t const to = std::min(static_cast<std::uint64_t>(end) * kPiece, size);
                     std::memset(first + from, 0, to - from);
                   });
}

} // namespace nanovtt::Internal
