// RunFinder: which positions of a chunk lie in which block.
//
//   block in the field           --> list of a share, written later; tiles that it lacks are listed
//   no block, positions in order --> block of the chunk's own, written at once
//   no block, scattered          --> list of a share, and the tiles are listed as missing
#pragma once

#include "GeometryVolume/channels/PartPlacesImpl.h"
#include "GeometryVolume/core/detail/SimdLanes.h"
#include "GeometryVolume/volume/FieldBulkImpl.h"

#include <algorithm>
#include <array>
#include <bit>
#include <cstddef>
#include <cstdint>
#include <cstring>
#include <span>
#include <utility>
#include <vector>

namespace VLN::TileTree3D::Internal {

/// Where positions lie as far apart as that many to a tile or fewer, chunks would make the same tiles again
/// and again.
inline constexpr std::uint64_t kScattered = 3;

/// Four positions as they lie in memory: x y z x, y z x y, z x y z.
struct FourPositions {
  UnsignedLanes a, b, c;
};

/// The axis along which `next` lies one sample behind `p`, or -1.
inline int axisBetween(int3 const& p, int3 const& next) {
  auto const difference = [](int to, int from) {
    return static_cast<std::uint32_t>(to) - static_cast<std::uint32_t>(from);
  };
  std::uint32_t const x = difference(next.x, p.x), y = difference(next.y, p.y), z = difference(next.z, p.z);
  return (x | y | z) == 1 && x + y + z == 1 ? static_cast<int>(y + 2 * z) : -1;
}

/// How many of the first positions lie each one sample behind the one before it along `axis`.
inline std::uint32_t straight(int3 const* p, std::uint32_t count, int axis) {
  static constexpr FourPositions kSteps[3] = {{{0, 0, 0, 1}, {0, 0, 2, 0}, {0, 3, 0, 0}},
                                              {{0, 0, 0, 0}, {1, 0, 0, 2}, {0, 0, 3, 0}},
                                              {{0, 0, 0, 0}, {0, 1, 0, 0}, {2, 0, 0, 3}}};
  static constexpr FourPositions kAdvance[3] = {{{4, 0, 0, 4}, {0, 0, 4, 0}, {0, 4, 0, 0}},
                                                {{0, 4, 0, 0}, {4, 0, 0, 4}, {0, 0, 4, 0}},
                                                {{0, 0, 4, 0}, {0, 4, 0, 0}, {4, 0, 0, 4}}};
  int3 const* const end = p + count;
  int3 const* next = p;
  if (count >= 4) {
    auto const load = [](int3 const* from, int lane) {
      UnsignedLanes out;
      std::memcpy(&out, reinterpret_cast<char const*>(from) + 16 * lane, sizeof(out));
      return out;
    };
    UnsignedLanes const first = load(p, 0);
    FourPositions const& step = kSteps[axis];
    FourPositions const advance = kAdvance[axis];
    UnsignedLanes a = __builtin_shufflevector(first, first, 0, 1, 2, 0) + step.a;
    UnsignedLanes b = __builtin_shufflevector(first, first, 1, 2, 0, 1) + step.b;
    UnsignedLanes c = __builtin_shufflevector(first, first, 2, 0, 1, 2) + step.c;
    for (; end - next >= 4; next += 4) {
      UnsignedLanes const off = (load(next, 0) ^ a) | (load(next, 1) ^ b) | (load(next, 2) ^ c);
      std::uint64_t halves[2];
      std::memcpy(halves, &off, sizeof(off));
      if (halves[0] | halves[1]) break;
      a += advance.a, b += advance.b, c += advance.c;
    }
  }
  if (next == p) ++next;
  for (; next < end; ++next)
    if (axisBetween(next[-1], *next) != axis) break;
  return static_cast<std::uint32_t>(next - p);
}

/// Where a chunk remembers a block. No two blocks of a plane of 32 x 32, across any axis, or of a cube of 8
/// meet in one place.
struct MemoPlace {
  static constexpr std::uint32_t kWidth = 32;
  std::uint32_t low, high;

  explicit MemoPlace(int3 const& p)
      : low(column(p.x) + 11 * column(p.z))
      , high(column(p.y) + 7 * column(p.z)) {}
  static std::uint32_t column(int c) { return static_cast<std::uint32_t>(c) >> 3; }
  std::size_t index() const { return low % kWidth + kWidth * (high % kWidth); }
  /// To the next block along an axis.
  void advance(int axis) {
    low += axis == 0 ? 1 : axis == 1 ? 0 : 11;
    high += axis == 0 ? 0 : axis == 1 ? 1 : 7;
  }
};

/// The axis of a row that begins here, or -1. Short rows are not worth finding their ends: those of a thin
/// band have other lengths each, which no processor foresees.
inline int rowAxis(int3 const* p, std::uint32_t count) {
  constexpr std::uint32_t kShort = 16;
  if (count < kShort) return -1;
  int const axis = axisBetween(p[0], p[1]);
  return axis >= 0 && std::int64_t(p[kShort - 1][axis]) - p[0][axis] == kShort - 1 ? axis : -1;
}

inline int3 cornerOf(int3 const& p) { return {p.x & ~7, p.y & ~7, p.z & ~7}; }

inline bool inBlock(int3 const& corner, int3 const& p) {
  return static_cast<std::uint32_t>((p.x ^ corner.x) | (p.y ^ corner.y) | (p.z ^ corner.z)) <
         static_cast<std::uint32_t>(FieldBlock::kWidth);
}

/// A block that positions were in. Rows of a field come back to the same blocks again and again.
struct SeenBlock {
  enum Kind : std::uint8_t { kOfField, kOwn, kListed };

  int3 corner{0, 0, 0};
  std::uint16_t list = 0; ///< that its runs go to
  Kind kind = kOfField;
  SlotBytes unknown = SlotBytes::all(); ///< neither there nor listed as missing
  FieldBlock* block = nullptr;          ///< null: none has been seen
};

/// What a chunk of positions was found to be.
struct Chunk {
  std::vector<BlockTiles> own;     ///< blocks that it made and wrote, because the field has none there
  BulkRunList ownRuns;             ///< what was written there
  std::vector<BlockTiles> missing; ///< tiles that are listed, each once, with blocks of the chunk's
  int3 const* outside = nullptr;
  bool isScattered = false; ///< whether few positions came to each new tile
  bool listsBlocks = false; ///< whether blocks are listed that the field lacks as a whole
};

class RunFinder {
public:
  /// @param made Gets the chunk's blocks.
  /// @param lists One for each share, and one for what is written at once.
  RunFinder(FieldBlocks const& blocks, ChunkBlocks& made, BulkRuns const& plan, ChunkTiles& tiles,
            BulkRunList* lists)
      : m_blocks(blocks)
      , m_made(made)
      , m_plan(plan)
      , m_tiles(tiles)
      , m_lists(lists) {}

  /// @param places Gets those of loose positions.
  /// @param isScattered Whether the chunk is to make no blocks for itself.
  Chunk find(std::span<int3 const> positions, BulkPlace* places, bool isScattered) {
    m_out.isScattered = isScattered;
    auto const count = static_cast<std::uint32_t>(positions.size());
    for (std::uint32_t n = 0; n < count && !m_out.outside;) {
      int3 const* const p = positions.data() + n;
      int const axis = rowAxis(p, count - n);
      n += axis < 0 ? addLoose(p, n, std::min(count - n, PartPlaces::kMost), places + n)
                    : addRow(p, n, straight(p, count - n, axis), axis);
      writeOwn(places);
      m_out.isScattered = m_out.isScattered || kScattered * m_ownTiles > n;
    }
    for (BlockTiles& tiles : m_out.missing) tiles.slots = tilesOf(*tiles.block);
    m_out.ownRuns = std::move(m_lists[m_plan.shares]);
    return std::move(m_out);
  }

private:
  /// @return `length`.
  [[gnu::noinline]] std::uint32_t addRow(int3 const* p, std::uint32_t begin, std::uint32_t length, int axis) {
    for (std::uint32_t done = 0; done < length;) {
      std::uint32_t const along = static_cast<std::uint32_t>(p[done][axis]) & 7;
      std::uint32_t const count = std::min(length - done, 8 - along);
      auto const place = FieldBlock::place(p[done].x, p[done].y, p[done].z);
      std::uint32_t const slots =
          1u << place.slot() | ((along & 3) + count > 4 ? 1u << (place.slot() + (1u << axis)) : 0);
      BulkRun run{nullptr,
                  0,
                  static_cast<std::uint8_t>(count),
                  static_cast<std::uint8_t>(axis),
                  static_cast<std::uint8_t>(place.slot()),
                  static_cast<std::uint8_t>(place.element())};
      MemoPlace memo(p[done]);
      do { // whole blocks in a row differ in nothing else
        SeenBlock* const seen = see(p[done], SlotBytes{slots}, memo);
        if (!seen) return length;
        run.block = seen->block;
        run.begin = begin + done;
        m_lists[seen->list].push_back(run);
        done += count;
        memo.advance(axis);
      } while (count == 8 && length - done >= 8);
    }
    return length;
  }
  /// @return `count`.
  [[gnu::noinline]] std::uint32_t addLoose(int3 const* p, std::uint32_t begin, std::uint32_t count,
                                           BulkPlace* places) {
    ArrayAhead const values{m_tiles.values.begin + begin * m_tiles.values.elementSize,
                            m_writesOwn ? m_tiles.values.elementSize : 0};
    m_part.find(p, count, places, values);
    addRuns(p, begin, count);
    return count;
  }
  void addRuns(int3 const* p, std::uint32_t begin, std::uint32_t count) {
    std::uint32_t const* const starts = m_part.runStarts();
    for (std::uint32_t run = 0; starts[run] < count; ++run) {
      std::uint32_t first = starts[run], length = starts[run + 1] - first;
      int3 const& at = p[first];
      SeenBlock const* const seen = see(at, m_part.slotsOf(first, length), MemoPlace(at));
      if (!seen) return;
      auto& list = m_lists[seen->list];
      for (; length > 255; first += 255, length -= 255)
        list.push_back({seen->block, begin + first, 255, BulkRun::kLoose, 0, 0});
      list.push_back({seen->block, begin + first, static_cast<std::uint8_t>(length), BulkRun::kLoose, 0, 0});
    }
  }
  /// The block that holds a position, with tiles at `slots`. Null beyond the domain.
  SeenBlock* see(int3 const& p, SlotBytes slots, MemoPlace const& memo) {
    SeenBlock& seen = m_seen[memo.index()];
    bool const known = inBlock(seen.corner, p) && !slots.anyOf(seen.unknown);
    return known || lookUp(p, slots, seen) ? &seen : nullptr;
  }
  [[gnu::noinline]] bool lookUp(int3 const& p, SlotBytes slots, SeenBlock& seen) {
    if (!seen.block || !inBlock(seen.corner, p)) {
      if (!VolumeShape::inDomain(p)) {
        m_out.outside = &p;
        return false;
      }
      remember(p, seen);
    }
    std::uint32_t const missing = slots.bits() & seen.unknown.bits();
    if (!missing) return true;
    if (seen.kind == SeenBlock::kOwn) {
      m_tiles.make({p, missing, seen.block});
      m_ownTiles += static_cast<std::uint64_t>(std::popcount(missing));
    } else {
      FieldBlock& listed = seen.kind == SeenBlock::kListed ? *seen.block : list(p);
      for (std::uint32_t left = missing; left; left &= left - 1)
        listed.tiles[std::countr_zero(left)].storeRelaxed(this);
    }
    seen.unknown.drop(missing);
    return true;
  }
  /// The block that holds a position, with the tiles that it has by now.
  void remember(int3 const& p, SeenBlock& seen) {
    FieldBlock* block = m_blocks.find(p.x, p.y, p.z);
    seen.kind = SeenBlock::kOfField;
    if (block == FieldBlocks::noBlock()) {
      seen.kind = SeenBlock::kOwn;
      block = m_out.isScattered ? m_made.own.find(p.x, p.y, p.z) : &m_made.own.make(p);
      if (block == FieldBlocks::noBlock()) {
        seen.kind = SeenBlock::kListed;
        block = &list(p);
        m_out.listsBlocks = true;
      }
    }
    std::uint32_t const there = tilesOf(*block);
    if (!there && seen.kind == SeenBlock::kOwn) m_out.own.push_back({p, 0, block});
    seen.corner = cornerOf(p);
    seen.list = static_cast<std::uint16_t>(seen.kind == SeenBlock::kOwn ? m_plan.shares : m_plan.shareOf(p));
    seen.unknown = SlotBytes::all();
    seen.unknown.drop(there);
    seen.block = block;
  }
  static std::uint32_t tilesOf(FieldBlock const& block) {
    std::uint32_t out = 0;
    for (std::size_t slot = 0; slot < block.tiles.size(); ++slot)
      out |= std::uint32_t(block.tiles[slot].loadAcquire() != nullptr) << slot;
    return out;
  }
  /// A block in which tiles are listed, at least one soon.
  FieldBlock& list(int3 const& p) {
    FieldBlock& block = m_made.listed.make(p);
    if (!tilesOf(block)) m_out.missing.push_back({p, 0, &block});
    return block;
  }
  void writeOwn(BulkPlace const* places) {
    auto const& runs = m_lists[m_plan.shares];
    m_writesOwn = m_ownWritten < runs.size();
    if (m_writesOwn) m_tiles.write(std::span(runs).subspan(m_ownWritten), places);
    m_ownWritten = runs.size();
  }

  FieldBlocks const& m_blocks;
  ChunkBlocks& m_made;
  BulkRuns const& m_plan;
  ChunkTiles& m_tiles;
  BulkRunList* m_lists;
  std::uint64_t m_ownTiles = 0;
  std::size_t m_ownWritten = 0; ///< of the runs
  bool m_writesOwn = false;
  PartPlaces m_part;
  std::array<SeenBlock, MemoPlace::kWidth * MemoPlace::kWidth> m_seen{};
  Chunk m_out;
};

} // namespace VLN::TileTree3D::Internal
