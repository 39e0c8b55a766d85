// Writing many elements: which lie in which block, and which tiles are missing.
#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/core/RollbackImpl.h"
#include "GeometryVolume/core/detail/SimdLanes.h"
#include "GeometryVolume/volume/FieldBulkImpl.h"
#include "GeometryVolume/volume/PartPlacesImpl.h"

#include <algorithm>
#include <array>
#include <bit>
#include <cstring>
#include <utility>

namespace VLN::TileTree3D::Internal {

namespace {

/// What a chunk of positions lacks, each tile once.
struct Chunk {
  std::vector<BlockTiles> missing; ///< in the order of the positions, with blocks that are the chunk's own
  std::size_t first = 0;           ///< among those of its round
  int3 const* outside = nullptr;
};

/// Four positions as they lie in memory: x y z x, y z x y, z x y z.
struct FourPositions {
  UnsignedLanes a, b, c;
};

/// The axis along which `next` lies one sample behind `p`, or -1.
int axisBetween(int3 const& p, int3 const& next) {
  auto const difference = [](int to, int from) {
    return static_cast<std::uint32_t>(to) - static_cast<std::uint32_t>(from);
  };
  std::uint32_t const x = difference(next.x, p.x), y = difference(next.y, p.y), z = difference(next.z, p.z);
  return (x | y | z) == 1 && x + y + z == 1 ? static_cast<int>(y + 2 * z) : -1;
}

/// How many of the first positions lie each one sample behind the one before it along `axis`.
std::uint32_t straight(int3 const* p, std::uint32_t count, int axis) {
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
int rowAxis(int3 const* p, std::uint32_t count) {
  constexpr std::uint32_t kShort = 16;
  if (count < kShort) return -1;
  int const axis = axisBetween(p[0], p[1]);
  return axis >= 0 && std::int64_t(p[kShort - 1][axis]) - p[0][axis] == kShort - 1 ? axis : -1;
}

bool inBlock(int3 const& corner, int3 const& p) {
  return static_cast<std::uint32_t>((p.x ^ corner.x) | (p.y ^ corner.y) | (p.z ^ corner.z)) <
         static_cast<std::uint32_t>(FieldBlock::kWidth);
}

/// A block that positions were in. Rows of a field come back to the same blocks again and again.
struct SeenBlock {
  int3 corner{0, 0, 0};
  std::uint16_t share = 0;
  bool isMade = false;                  ///< whether the block was made for it
  SlotBytes unknown = SlotBytes::all(); ///< neither there nor listed as missing
  FieldBlock* block = nullptr;          ///< null: none has been seen
};

class RunFinder {
public:
  /// @param made Gets blocks for those that the field lacks.
  /// @param lists One for each share.
  RunFinder(FieldBlocks const& blocks, FieldBlocks& made, BulkRuns const& plan, std::vector<BulkRun>* lists)
      : m_blocks(blocks)
      , m_made(made)
      , m_plan(plan)
      , m_lists(lists) {}

  /// @param places Gets those of loose positions.
  Chunk find(std::span<int3 const> positions, BulkPlace* places) {
    m_positions = positions.data();
    auto const count = static_cast<std::uint32_t>(positions.size());
    for (std::uint32_t n = 0; n < count && !m_out.outside;) {
      int3 const* const p = positions.data() + n;
      int const axis = rowAxis(p, count - n);
      n += axis < 0 ? addLoose(p, n, std::min(count - n, PartPlaces::kMost), places + n)
                    : addRow(p, n, straight(p, count - n, axis), axis);
    }
    for (BlockTiles& tiles : m_out.missing)
      for (std::size_t slot = 0; slot < tiles.block->tiles.size(); ++slot)
        if (tiles.block->tiles[slot].loadRelaxed()) tiles.slots |= 1u << slot;
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
        m_lists[seen->share].push_back(run);
        done += count;
        memo.advance(axis);
      } while (count == 8 && length - done >= 8);
    }
    return length;
  }
  /// @return `count`.
  [[gnu::noinline]] std::uint32_t addLoose(int3 const* p, std::uint32_t begin, std::uint32_t count,
                                           BulkPlace* places) {
    m_part.find(p, count, places);
    std::uint32_t const* const starts = m_part.runStarts();
    for (std::uint32_t run = 0; starts[run] < count; ++run) {
      std::uint32_t first = starts[run], length = starts[run + 1] - first;
      SeenBlock* const seen = see(p[first], m_part.slotsOf(first, length), MemoPlace(p[first]));
      if (!seen) break;
      auto& list = m_lists[seen->share];
      for (; length > 255; first += 255, length -= 255)
        list.push_back({seen->block, begin + first, 255, BulkRun::kLoose, 0, 0});
      list.push_back({seen->block, begin + first, static_cast<std::uint8_t>(length), BulkRun::kLoose, 0, 0});
    }
    return count;
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
      seen = {{p.x & ~7, p.y & ~7, p.z & ~7},
              static_cast<std::uint16_t>(m_plan.shareOf(p)),
              false,
              SlotBytes::all(),
              m_blocks.find(p.x, p.y, p.z)};
      seen.isMade = seen.block == FieldBlocks::noBlock();
      if (seen.isMade) seen.block = &list(p);
      std::uint32_t there = 0;
      for (std::size_t slot = 0; slot < seen.block->tiles.size(); ++slot)
        there |= std::uint32_t(seen.block->tiles[slot].loadAcquire() != nullptr) << slot;
      seen.unknown.drop(there);
    }
    if (!slots.anyOf(seen.unknown)) return true;
    FieldBlock& listed = seen.isMade ? *seen.block : list(p);
    std::uint32_t const missing = slots.bits() & seen.unknown.bits();
    for (std::uint32_t left = missing; left; left &= left - 1)
      listed.tiles[static_cast<std::size_t>(std::countr_zero(left))].storeRelaxed(this);
    seen.unknown.drop(missing);
    return true;
  }
  FieldBlock& list(int3 const& p) {
    FieldBlock* const block = m_made.find(p.x, p.y, p.z);
    if (block != FieldBlocks::noBlock()) return *block;
    auto const number = static_cast<std::uint32_t>(&p - m_positions);
    return *m_out.missing.emplace_back(BlockTiles{p, 0, &m_made.make(p), number}).block;
  }
  FieldBlocks const& m_blocks;
  FieldBlocks& m_made;
  BulkRuns const& m_plan;
  std::vector<BulkRun>* m_lists;
  int3 const* m_positions = nullptr;
  PartPlaces m_part;
  std::array<SeenBlock, MemoPlace::kWidth * MemoPlace::kWidth> m_seen{};
  Chunk m_out;
};

} // namespace

BulkRuns planBulk(VolumeData& volume, FieldSlot& slot, std::span<int3 const> positions) {
  volume.prepareWrite(slot);
  BulkRuns out;
  out.grain = std::clamp<std::size_t>(positions.size() / 32, 16384, 1 << 20);
  out.chunks = (positions.size() + out.grain - 1) / out.grain;
  out.shares = static_cast<std::size_t>(parallelThreads());
  out.lists.resize(out.chunks * out.shares);
  out.made.resize(out.chunks);
  out.tilesMade.resize(out.chunks);
  // Round by round, each as long as all before it: positions at random ask for the same tiles over and over,
  // and those that the first rounds have made are not listed again.
  std::vector<BlockTiles> missing;
  VLN::Internal::Rollback unwritten([&] {
    out.writeBackground(slot);
    for (BlockTiles& tiles : missing) slot.writeBackground(tiles);
  });
  out.places.reset(new BulkPlace[positions.size()]);
  std::vector<Chunk> found(out.chunks);
  for (std::size_t first = 0, last = out.shares; first < out.chunks; first = last, last *= 2) {
    last = std::min(last, out.chunks);
    auto const forEachChunk = [&](FunctionRef<void(std::size_t)> body) {
      parallelFor(static_cast<std::int64_t>(first), static_cast<std::int64_t>(last),
                  [&](std::int64_t begin, std::int64_t end) {
                    for (auto c = begin; c < end; ++c) body(static_cast<std::size_t>(c));
                  });
    };
    forEachChunk([&](std::size_t c) {
      std::size_t const begin = c * out.grain;
      auto const part = positions.subspan(begin, std::min(positions.size() - begin, out.grain));
      // The thread's own until they are full: lists of neighbours share lines of the cache.
      std::vector<std::vector<BulkRun>> lists(out.shares);
      // Enough for short rows.
      for (auto& list : lists) list.reserve(part.size() / (2 * out.shares));
      found[c] = RunFinder(slot.blocks, out.made[c], out, lists.data()).find(part, &out.places[begin]);
      std::move(lists.begin(), lists.end(), &out.list(c, 0));
    });
    missing.clear();
    for (std::size_t c = first; c < last; ++c) {
      if (found[c].outside) throwOutside(*found[c].outside);
      found[c].first = missing.size();
      missing.insert(missing.end(), found[c].missing.begin(), found[c].missing.end());
    }
    if (missing.empty()) continue;
    slot.makePending(volume, missing, true);
    for (std::size_t c = first; c < last; ++c) out.tilesMade[c].swap(found[c].missing);
    forEachChunk([&](std::size_t c) {
      auto made = missing.begin() + static_cast<std::ptrdiff_t>(found[c].first);
      for (BlockTiles& tiles : out.tilesMade[c]) {
        FieldBlock& copy = *std::exchange(tiles, *made++).block;
        for (std::size_t n = 0; n < copy.tiles.size(); ++n)
          copy.tiles[n].storeRelaxed(tiles.block->tiles[n].loadAcquire());
      }
    });
  }
  unwritten.dismiss();
  return out;
}

} // namespace VLN::TileTree3D::Internal
