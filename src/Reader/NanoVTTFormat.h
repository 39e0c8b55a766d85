// The NanoVTT buffer: every offset, size and number of the format, once, for its writer and its readers.
//
//   ┌───────────────────────────── container section ─────────────────────────────┐
//   │ sizes │ tileCountAccum │ root table 64³ │ llc, rootDepth │ child offsets │    │
//   │ parent table │ child tables, dense blocks │ sentinel (32 bytes of 0xFF) │ pad │
//   ├───────────────────────────── one grid per channel ──────────────────────────┤
//   │ grid header │ tree header │ tile table │ tile data │ pad                      │
//   └──────────────────────────────────────────────────────────────────────────────┘
//
// Offsets here count from the first byte of the section that they belong to; docs/flat_buffer.md has the byte
// tables. The format is little-endian, and so must the machine be.
//
// This header and its neighbours in src/Reader depend on nothing but the C++17 standard library, allocate
// nothing, throw nothing, and compile for host and device.
#pragma once

#include <cstddef>
#include <cstdint>
#include <cstring>

#if defined(__CUDACC__)
#define NANOVTT_HD __host__ __device__
#else
#define NANOVTT_HD
#endif

// For what each step of a cursor runs: a block that comes back through memory is copied, and the copy waits
// for the loads behind it, so that reads at random no longer wait side by side.
#if defined(__GNUC__) && !defined(__CUDACC__)
#define NANOVTT_INLINE __attribute__((always_inline)) inline
#else
#define NANOVTT_INLINE NANOVTT_HD inline
#endif

#if defined(__BYTE_ORDER__) && __BYTE_ORDER__ != __ORDER_LITTLE_ENDIAN__
#error "NanoVTT buffers are little-endian; this machine is not"
#endif

namespace nanovtt {

/// Reads a value that lies at any address.
template <class T> NANOVTT_HD inline T load(void const* p) {
#if defined(__CUDA_ARCH__)
  // Device memory is aligned, and every field of the format then lies at a multiple of its own size.
  return *static_cast<T const*>(p);
#else
  T value;
  std::memcpy(static_cast<void*>(&value), p, sizeof(T));
  return value;
#endif
}

/// Writes a value to any address.
template <class T> NANOVTT_HD inline void store(void* p, T const& value) {
#if defined(__CUDA_ARCH__)
  *static_cast<T*>(p) = value;
#else
  std::memcpy(p, static_cast<void const*>(&value), sizeof(T));
#endif
}

// --- Everywhere
// -----------------------------------------------------------------------------------------------

/// A missing tile: an empty root slot, a missing child, the parent of a root.
inline constexpr std::uint32_t kNoTile = 0xFFFFFFFFu;
/// Offsets in 64-bit entries take the lower 48 bits.
inline constexpr std::uint64_t kOffsetMask = 0xFFFFFFFFFFFFull;
/// Sections start at multiples of this, counted from the start of the buffer.
inline constexpr std::uint64_t kSectionAlignment = 32;

/// The unconditional padding of every section: a size that is a multiple of 32 already grows by 32.
NANOVTT_HD constexpr std::uint64_t padSection(std::uint64_t size) {
  return size + (kSectionAlignment - size % kSectionAlignment);
}

// --- The tree
// -------------------------------------------------------------------------------------------------

inline constexpr int kMaxDepth = 28;
/// log2 of the width of a tile of depth 0, in tile space. A tile of depth d is 2^(30-d) wide.
inline constexpr int kTileSpaceBits = 30;
/// Samples along the edge of a tile, without and with the halo layer on the high side of each axis.
inline constexpr int kTileWidth = 4;
inline constexpr int kHaloTileWidth = 5;
inline constexpr int kTileSamples = 64;
inline constexpr int kHaloTileSamples = 125;
/// The most complete levels that merge into one dense block.
inline constexpr int kMaxCoalescedLevels = 3;

// --- Container section
// ----------------------------------------------------------------------------------------

inline constexpr std::uint64_t kBufferSizeOffset = 0;        // u64
inline constexpr std::uint64_t kContainerSizeOffset = 8;     // u64
inline constexpr std::uint64_t kTileCountAccumOffset = 16;   // u32[30]
inline constexpr std::uint64_t kRootTableOffset = 136;       // u32[64][64][64], x fastest
inline constexpr std::uint64_t kLlcOffset = 1048712;         // i32[3]
inline constexpr std::uint64_t kRootDepthOffset = 1048724;   // i32
inline constexpr std::uint64_t kParentTableOffset = 1048728; // u64, counts from kChildOffsetsBase
inline constexpr std::uint64_t kChildOffsetsBase = 1048736;  // u64[numNonFinestTiles + 1]
inline constexpr int kTileCountAccumEntries = 30;
inline constexpr std::uint32_t kRootTableWidth = 64;
inline constexpr std::uint32_t kMaxRoots = 64 * 64 * 64;
/// A plain child table, and the sentinel that all tiles without children share.
inline constexpr std::uint64_t kChildTableBytes = 32;
inline constexpr std::uint64_t kSentinelBytes = 32;
/// The container's size is this, the tables behind kChildOffsetsBase, and the padding.
inline constexpr std::uint64_t kContainerFixedBytes = kChildOffsetsBase + kSentinelBytes;
/// Child offset entry: bits 56 to 63 are the level count of an incomplete coalesced block.
inline constexpr int kChildLevelsShift = 56;

static_assert(kRootTableOffset == kTileCountAccumOffset + kTileCountAccumEntries * 4, "");
static_assert(kLlcOffset == kRootTableOffset + std::uint64_t(kMaxRoots) * 4, "");
static_assert(kChildOffsetsBase == kParentTableOffset + 8, "");

/// Bytes of child offsets and parent table: where the child tables start, counted from kChildOffsetsBase.
NANOVTT_HD constexpr std::uint64_t childTablesStart(std::uint64_t tiles, std::uint64_t nonFinestTiles) {
  return 4 * (tiles + 2 + 2 * nonFinestTiles);
}

// --- Grid
// -----------------------------------------------------------------------------------------------------

inline constexpr std::uint64_t kGridMagic = 0x4E616E6F56545430ull;
inline constexpr std::uint32_t kGridVersion = 0x200000u;
inline constexpr std::uint64_t kEmptyChecksum = ~0ull;

inline constexpr std::uint64_t kGridMagicOffset = 0;                // u64
inline constexpr std::uint64_t kGridChecksumOffset = 8;             // u64
inline constexpr std::uint64_t kGridVersionOffset = 16;             // u32
inline constexpr std::uint64_t kGridFlagsOffset = 20;               // u32
inline constexpr std::uint64_t kGridIndexOffset = 24;               // u32
inline constexpr std::uint64_t kGridCountOffset = 28;               // u32
inline constexpr std::uint64_t kGridSizeOffset = 32;                // u64
inline constexpr std::uint64_t kGridNameOffset = 40;                // char[256], the last byte is 0
inline constexpr std::uint64_t kGridMapOffset = 296;                // see below
inline constexpr std::uint64_t kGridWorldBBoxOffset = 560;          // double[6], minimum then maximum
inline constexpr std::uint64_t kGridVoxelSizeOffset = 608;          // double[3]
inline constexpr std::uint64_t kGridClassOffset = 632;              // u32
inline constexpr std::uint64_t kGridTypeOffset = 636;               // u32
inline constexpr std::uint64_t kGridBlindMetadataOffset = 640;      // i64
inline constexpr std::uint64_t kGridBlindMetadataCountOffset = 648; // u32
inline constexpr std::uint64_t kTreeOffset = 672;                   // the tree header starts here
inline constexpr std::uint64_t kTreeBBoxOffset = 672;               // i32[6], minimum then maximum
inline constexpr std::uint64_t kTreeContainerOffset = 696; // u64, bytes from the buffer's start to the tree
inline constexpr std::uint64_t kTreeSizeOffset = 704;      // u64
inline constexpr std::uint64_t kTreeDefaultOffset = 712;   // the element type
inline constexpr std::uint64_t kTileTableOffset = 736; // u64[tiles + 1]; tile data offsets count from here
inline constexpr std::uint64_t kGridNameBytes = 256;
inline constexpr std::uint64_t kGridMapBytes = 264;
/// A grid's size is this, the tile table, the tile data, and the padding.
inline constexpr std::uint64_t kGridHeaderBytes = kTileTableOffset;

// The map, counted from the grid's start: matrix, inverse, translation and taper in float, then in double.
inline constexpr std::uint64_t kMapMatrixFOffset = 296;      // float[9]
inline constexpr std::uint64_t kMapInverseFOffset = 332;     // float[9]
inline constexpr std::uint64_t kMapTranslationFOffset = 368; // float[3]
inline constexpr std::uint64_t kMapTaperFOffset = 380;       // float
inline constexpr std::uint64_t kMapMatrixDOffset = 384;      // double[9]
inline constexpr std::uint64_t kMapInverseDOffset = 456;     // double[9]
inline constexpr std::uint64_t kMapTranslationDOffset = 528; // double[3]
inline constexpr std::uint64_t kMapTaperDOffset = 552;       // double

static_assert(kGridMapOffset == kGridNameOffset + kGridNameBytes, "");
static_assert(kGridWorldBBoxOffset == kGridMapOffset + kGridMapBytes, "");

enum class GridClass : std::uint32_t { kOther = 0, kLevelSet = 1, kFogVolume = 2 };

enum class GridType : std::uint32_t {
  kFloat = 1,
  kDouble = 2,
  kInt16 = 3,
  kInt32 = 4,
  kInt64 = 5,
  kFloat3 = 6,
  kDouble3 = 7,
  kUInt32 = 10,
  kFp4 = 13,
  kFp8 = 14,
  kFp16 = 15,
  kFpN = 16,
  kFloat4 = 17,
};

/// Bytes of one element as a channel holds it: of a sample where it is stored as it is, and of the default
/// value. 0 for a type that the format does not have.
NANOVTT_HD constexpr std::uint64_t elementBytes(GridType type) {
  switch (type) {
  case GridType::kInt16:
    return 2;
  case GridType::kFloat:
  case GridType::kInt32:
  case GridType::kUInt32:
  case GridType::kFp4:
  case GridType::kFp8:
  case GridType::kFp16:
  case GridType::kFpN:
    return 4;
  case GridType::kDouble:
  case GridType::kInt64:
    return 8;
  case GridType::kFloat3:
    return 12;
  case GridType::kFloat4:
    return 16;
  case GridType::kDouble3:
    return 24;
  }
  return 0;
}

NANOVTT_HD constexpr bool isQuantised(GridType type) {
  return type == GridType::kFp4 || type == GridType::kFp8 || type == GridType::kFp16 ||
         type == GridType::kFpN;
}

/// Bits of one code where all tiles have the same; 0 otherwise.
NANOVTT_HD constexpr int codeBits(GridType type) {
  return type == GridType::kFp4 ? 4 : type == GridType::kFp8 ? 8 : type == GridType::kFp16 ? 16 : 0;
}

// A quantised tile starts with these, and its codes follow.
inline constexpr std::uint64_t kQuantisedMinimumOffset = 0; // float
inline constexpr std::uint64_t kQuantisedQuantumOffset = 4; // float
inline constexpr std::uint64_t kQuantisedCodesOffset = 8;   // Fp4, Fp8 and Fp16
// A tile of FpN has a longer record.
inline constexpr std::uint64_t kFpNPayloadOffset = 8;   // u16, bytes of codes
inline constexpr std::uint64_t kFpNLogBitsOffset = 10;  // u8, log2 of the bits of a code
inline constexpr std::uint64_t kFpNReservedOffset = 11; // u8, 0
inline constexpr std::uint64_t kFpNRecordBytes = 12;
/// Codes of a halo tile in FpN: 125, padded so that they fill whole bytes at every width.
inline constexpr int kFpNHaloCodes = 128;

/// Bytes that a tile takes in the tile data. Not for FpN, whose tiles differ.
NANOVTT_HD constexpr std::uint64_t tileBytes(GridType type, bool halo) {
  switch (type) {
  case GridType::kFp4:
    return halo ? 72 : 44;
  case GridType::kFp8:
    return halo ? 136 : 76;
  case GridType::kFp16:
    return halo ? 264 : 140;
  case GridType::kFpN:
    return 0;
  default:
    return elementBytes(type) * static_cast<std::uint64_t>(halo ? kHaloTileSamples : kTileSamples);
  }
}

/// Tile table entry: bits 48 to 55 are the width in samples, bits 56 to 63 the levels of a coalesced block.
inline constexpr int kTileWidthShift = 48;
inline constexpr int kTileLevelsShift = 56;

NANOVTT_HD constexpr std::uint64_t tileEntry(std::uint64_t offset, std::uint64_t width,
                                             std::uint64_t levels) {
  return offset | width << kTileWidthShift | levels << kTileLevelsShift;
}
/// Entry of a tile in texture mode: the position of its brick, each in multiples of the brick's 5 samples.
NANOVTT_HD constexpr std::uint64_t textureEntry(std::uint64_t x, std::uint64_t y, std::uint64_t z) {
  return x * kHaloTileWidth | (y * kHaloTileWidth) << 16 | (z * kHaloTileWidth) << 32 |
         std::uint64_t(kHaloTileWidth) << kTileWidthShift;
}

// --- Traversal and neighbour structures
// -----------------------------------------------------------------------

/// i, j, k and depth of each tile, four i32.
inline constexpr std::uint64_t kTraversalRowBytes = 16;
/// 27 tile numbers for each tile; z is fastest.
inline constexpr std::uint64_t kNeighborRowBytes = 108;
/// What the size of the neighbour structure counts for each tile: twice what its rows take.
inline constexpr std::uint64_t kNeighborAllocatedRowBytes = 216;

} // namespace nanovtt
