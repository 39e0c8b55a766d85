// Writing many elements: which lie in which block, and which tiles are missing.
#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/core/detail/SimdLanes.h"
#include "GeometryVolume/volume/FieldBulkImpl.h"

#include <algorithm>
#include <array>
#include <bit>
#include <cstring>
#include <utility>

namespace VLN::TileTree3D::Internal {

namespace {

/// What a chunk of positions lacks, each tile once.
struct Chunk {
  std::vector<BlockTiles> missing; ///< with blocks that are the chunk's own
  std::size_t first = 0;           ///< among those of its round
  int3 const* outside = nullptr;
};

/// Which share writes a block. Shares are made of cubes of 32 samples: small enough to balance, and wide
/// enough that positions in order are read in order.
std::size_t shareOf(int3 const& at, std::size_t shares) {
  auto const x = static_cast<std::uint32_t>(at.x) >> 5, y = static_cast<std::uint32_t>(at.y) >> 5,
             z = static_cast<std::uint32_t>(at.z) >> 5;
  return (x + 3 * y + 5 * z) % shares;
}

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
  constexpr std::uint32_t kShort = 8;
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
  std::uint32_t known = 0;              ///< tiles that exist or are listed as missing
  FieldBlock* block = nullptr;          ///< the field's, or one made for it
  FieldBlock* listed = nullptr;         ///< entered there are the tiles that are missing
  std::vector<BulkRun>* list = nullptr; ///< null: no block
};

class RunFinder {
public:
  /// @param made Gets blocks for those that the field lacks.
  /// @param lists One for each share.
  RunFinder(FieldBlocks const& blocks, FieldBlocks& made, std::size_t shares, std::vector<BulkRun>* lists)
      : m_blocks(blocks)
      , m_made(made)
      , m_shares(shares)
      , m_lists(lists) {}

  Chunk find(std::span<int3 const> positions) {
    auto const count = static_cast<std::uint32_t>(positions.size());
    for (std::uint32_t n = 0; n < count && !m_out.outside;) {
      int3 const* const p = positions.data() + n;
      int const axis = rowAxis(p, count - n);
      n += axis < 0 ? addLoose(p, n, count - n) : addRow(p, n, straight(p, count - n, axis), axis);
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
        SeenBlock* const seen = see(p[done], slots, memo);
        if (!seen) return length;
        run.block = seen->block;
        run.begin = begin + done;
        seen->list->push_back(run);
        done += count;
        memo.advance(axis);
      } while (count == 8 && length - done >= 8);
    }
    return length;
  }
  /// @return How many positions the run took: those that follow in the block.
  [[gnu::noinline]] std::uint32_t addLoose(int3 const* p, std::uint32_t begin, std::uint32_t most) {
    auto const slotOf = [](int3 const& at) { return 1u << FieldBlock::place(at.x, at.y, at.z).slot(); };
    SeenBlock* const seen = see(p[0], slotOf(p[0]), MemoPlace(p[0]));
    if (!seen) return 1;
    std::uint32_t count = 1;
    for (most = std::min(most, 255u); count < most && inBlock(seen->corner, p[count]); ++count) {
      if (std::uint32_t const slots = slotOf(p[count]); slots & ~seen->known) lookUp(p[count], slots, *seen);
    }
    seen->list->push_back({seen->block, begin, static_cast<std::uint8_t>(count), BulkRun::kLoose, 0, 0});
    return count;
  }
  /// The block that holds a position, with tiles at `slots`. Null beyond the domain.
  SeenBlock* see(int3 const& p, std::uint32_t slots, MemoPlace const& memo) {
    SeenBlock& seen = m_seen[memo.index()];
    bool const known = inBlock(seen.corner, p) && !(slots & ~seen.known);
    return known || lookUp(p, slots, seen) ? &seen : nullptr;
  }
  [[gnu::noinline]] bool lookUp(int3 const& p, std::uint32_t slots, SeenBlock& seen) {
    if (!seen.list || !inBlock(seen.corner, p)) {
      if (!VolumeShape::inDomain(p)) {
        m_out.outside = &p;
        return false;
      }
      seen = {{p.x & ~7, p.y & ~7, p.z & ~7},
              0,
              m_blocks.find(p.x, p.y, p.z),
              nullptr,
              &m_lists[shareOf(p, m_shares)]};
      if (seen.block == FieldBlocks::noBlock()) seen.block = seen.listed = &list(p);
    }
    for (std::uint32_t left = slots & ~seen.known; left; left &= left - 1) {
      auto const slot = static_cast<std::size_t>(std::countr_zero(left));
      if (seen.block->tiles[slot].loadAcquire()) continue;
      if (!seen.listed) seen.listed = &list(p);
      seen.listed->tiles[slot].storeRelaxed(this);
    }
    seen.known |= slots;
    return true;
  }
  FieldBlock& list(int3 const& p) {
    FieldBlock* const block = m_made.find(p.x, p.y, p.z);
    if (block != FieldBlocks::noBlock()) return *block;
    return *m_out.missing.emplace_back(BlockTiles{p, 0, &m_made.make(p)}).block;
  }
  FieldBlocks const& m_blocks;
  FieldBlocks& m_made;
  std::size_t m_shares;
  std::vector<BulkRun>* m_lists;
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
  std::vector<Chunk> found(out.chunks);
  // Round by round, each as long as all before it: positions at random ask for the same tiles over and over,
  // and those that the first rounds have made are not listed again.
  std::vector<BlockTiles> missing;
  for (std::size_t first = 0, last = 1; first < out.chunks; first = last, last *= 2) {
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
      // Enough for whole rows.
      for (auto& list : lists) list.reserve(part.size() / (6 * out.shares));
      found[c] = RunFinder(slot.blocks, out.made[c], out.shares, lists.data()).find(part);
      std::move(lists.begin(), lists.end(), &out.list(c, 0));
    });
    missing.clear();
    for (std::size_t c = first; c < last; ++c) {
      if (found[c].outside) throwOutside(*found[c].outside);
      found[c].first = missing.size();
      missing.insert(missing.end(), found[c].missing.begin(), found[c].missing.end());
    }
    if (missing.empty()) continue;
    slot.makePending(volume, missing);
    forEachChunk([&](std::size_t c) {
      for (std::size_t t = 0; t < found[c].missing.size(); ++t) {
        FieldBlock const& from = *missing[found[c].first + t].block;
        FieldBlock& to = *found[c].missing[t].block;
        for (std::size_t n = 0; n < to.tiles.size(); ++n)
          to.tiles[n].storeRelaxed(from.tiles[n].loadAcquire());
      }
    });
  }
  return out;
}

} // namespace VLN::TileTree3D::Internal
