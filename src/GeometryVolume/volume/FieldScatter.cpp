// Writing many elements at random places.
//
//   each chunk   sorts its positions by shares of the volume
//   each share   finds the elements of its positions, and makes the tiles that are missing
//   the field    takes the new blocks in
//   each share   writes
//
// A block belongs to one share: its thread makes tiles without asking others, and writes what comes last
// last.
#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/core/RollbackImpl.h"
#include "GeometryVolume/volume/FieldBulkImpl.h"

#include <algorithm>
#include <array>
#include <cstddef>
#include <cstdint>
#include <cstring>
#include <memory>
#include <numeric>
#include <span>
#include <utility>
#include <vector>

namespace VLN::TileTree3D::Internal {

namespace {

using Key = FieldBlocks::Key;

/// Shares for each thread, so that one that begins late does less.
constexpr std::size_t kShares = 4, kMostShares = 256;
/// Positions in a chunk.
constexpr std::size_t kLeastGrain = 4096, kMostGrain = 1 << 20;
/// How many positions of a share are looked at together.
constexpr std::size_t kPart = 256;
/// Parts to come for which nobody asks whether their blocks were met lately, once they were not.
constexpr std::uint32_t kFarParts = 32;

/// How many positions after each other are asked, and at how many places.
constexpr std::size_t kAsked = 16, kPlaces = 16;

/// The low corner of the block that holds a position.
struct Corner {
  std::uint64_t xy = 1;
  std::uint32_t z = 0;

  Corner() = default;
  explicit Corner(int3 const& p)
      : z(static_cast<std::uint32_t>(p.z) & ~7u) {
    std::memcpy(&xy, &p, sizeof(xy));
    xy &= 0xfffffff8fffffff8ull;
  }
  bool operator==(Corner const& other) const { return ((xy ^ other.xy) | (z ^ other.z)) == 0; }
  /// Which of the shares writes the block.
  std::uint8_t share(std::uint64_t count) const {
    std::uint64_t const mix = xy * 0x9e3779b97f4a7c15ull + z * 0xc2b2ae3d27d4eb4full;
    return static_cast<std::uint8_t>((mix >> 32) * count >> 32);
  }
};

/// Blocks that were met lately. No two of a cube of 9 x 9 x 9 meet in one place.
class MetBlocks {
public:
  struct Met {
    Corner corner; ///< at first none that a block has
    FieldBlock* block = nullptr;
  };

  Met& at(Corner const& c) { return m_met[((c.xy >> 3) + (c.xy >> 35) * 32 + (c.z >> 3) * 327) % kCount]; }

private:
  static constexpr std::size_t kCount = 1024;
  std::array<Met, kCount> m_met;
};

/// The positions of one share.
class Share {
public:
  Share(FieldBlocks const& blocks, ChunkTiles& tiles)
      : m_blocks(blocks)
      , m_tiles(tiles)
      , m_elementSize(tiles.values.elementSize) {}

  /// Finds the elements of the positions with these numbers, up to the first one beyond the domain.
  void find(int3 const* positions, std::span<std::uint32_t const> numbers, void** elements) {
    for (std::size_t n = 0; n < numbers.size() && !outside; n += kPart) {
      auto const part = numbers.subspan(n, std::min(kPart, numbers.size() - n));
      if (m_farParts > 0)
        findFar(positions, part, elements + n);
      else
        findNear(positions, part, elements + n);
    }
  }

  FieldBlocks own;              ///< where the field has none
  std::vector<BlockTiles> made; ///< all of `own`
  bool madeTiles = false;
  int3 const* outside = nullptr; ///< the first position beyond the domain

private:
  [[gnu::noinline]] void findNear(int3 const* positions, std::span<std::uint32_t const> numbers,
                                  void** elements) {
    std::size_t misses = 0;
    for (std::uint32_t const n : numbers) {
      int3 const& p = positions[n];
      Corner const corner(p);
      auto& met = m_met.at(corner);
      if (!(met.corner == corner)) [[unlikely]] {
        FieldBlock* const found = block(p);
        if (!found) return;
        met = {corner, found};
        ++misses;
      }
      *elements++ = element(p, *met.block);
    }
    if (2 * misses > numbers.size()) m_farParts = kFarParts;
  }
  [[gnu::noinline]] void findFar(int3 const* positions, std::span<std::uint32_t const> numbers,
                                 void** elements) {
    --m_farParts;
    std::array<FieldBlock*, kPart> blocks;
    for (std::uint32_t const n : numbers) {
      Key const key(positions[n]);
      m_blocks.prefetch(key);
      own.prefetch(key);
    }
    for (std::size_t i = 0; i < numbers.size(); ++i) {
      blocks[i] = block(positions[numbers[i]]);
      if (!blocks[i]) return;
      __builtin_prefetch(blocks[i]);
    }
    for (std::size_t i = 0; i < numbers.size(); ++i) elements[i] = element(positions[numbers[i]], *blocks[i]);
  }
  void* element(int3 const& p, FieldBlock& block) {
    auto const place = FieldBlock::place(p.x, p.y, p.z);
    void* tile = block.tile(place);
    if (!tile) [[unlikely]]
      tile = makeTile(p, place, block);
    return static_cast<char*>(tile) + place.element() * m_elementSize;
  }
  [[gnu::noinline]] FieldBlock* block(int3 const& p) {
    Key const key(p);
    FieldBlock* out = m_blocks.look(key);
    if (!out) out = own.look(key);
    return out ? out : makeBlock(p);
  }
  [[gnu::noinline]] FieldBlock* makeBlock(int3 const& p) {
    if (!VolumeShape::inDomain(p)) {
      outside = &p;
      return nullptr;
    }
    made.push_back({p, 0, &own.make(p)});
    return made.back().block;
  }
  [[gnu::noinline]] void* makeTile(int3 const& p, FieldBlock::Place place, FieldBlock& block) {
    m_tiles.make({p, 1u << place.slot(), &block});
    madeTiles = true;
    return block.tile(place);
  }

  FieldBlocks const& m_blocks;
  ChunkTiles& m_tiles;
  std::size_t m_elementSize;
  std::uint32_t m_farParts = 0; ///< to come
  MetBlocks m_met;
};

/// Numbers the positions of each chunk by shares.
void sortByShares(std::span<int3 const> positions, ScatteredElements& out) {
  parallelFor(0, static_cast<std::int64_t>(out.chunks()), [&](std::int64_t begin, std::int64_t end) {
    BulkList<std::uint8_t> shares;
    for (auto c = begin; c < end; ++c) {
      auto const chunk = positions.subspan(out.begins[c], out.begins[c + 1] - out.begins[c]);
      shares.resize(chunk.size());
      std::array<std::size_t, kMostShares> next{};
      for (std::size_t n = 0; n < chunk.size(); ++n) {
        shares[n] = Corner(chunk[n]).share(out.shares);
        ++next[shares[n]];
      }
      std::exclusive_scan(next.begin(), next.end(), next.begin(), out.begins[c]);
      for (std::size_t n = 0; n < chunk.size(); ++n)
        out.numbers[next[shares[n]]++] = static_cast<std::uint32_t>(n);
      std::copy_n(next.begin(), out.shares, &out.ends[c * out.shares]);
    }
  });
}

/// Gives the field the tiles and blocks that the shares have made.
void takeMade(VolumeData& volume, FieldSlot& slot, std::span<std::unique_ptr<Share> const> shares,
              std::span<std::unique_ptr<ChunkTiles>> tiles) {
  if (std::none_of(shares.begin(), shares.end(), [](auto const& share) { return share->madeTiles; })) return;
  slot.adopt(volume, tiles);
  std::size_t blocks = 0;
  for (auto const& share : shares) blocks += share->made.size();
  slot.blocks.reserve(blocks);
  for (auto const& share : shares) {
    slot.blocks.takeMemory(share->own);
    for (BlockTiles const& made : share->made) slot.blocks.make(made.position, made.block);
  }
}

} // namespace

bool isAtRandom(std::span<int3 const> positions) {
  std::size_t const count = positions.size(), step = std::max(count / kPlaces, kAsked);
  std::size_t changes = 0, steps = 0;
  for (std::size_t begin = 0; begin < count; begin += step) {
    auto const some = positions.subspan(begin, std::min(kAsked, count - begin));
    for (std::size_t n = 1; n < some.size(); ++n, ++steps) changes += Key(some[n - 1]).at != Key(some[n]).at;
  }
  return 2 * changes > steps;
}

ScatteredElements::ScatteredElements(std::size_t positions)
    : shares(std::clamp<std::size_t>(positions / kLeastGrain, 1,
                                     std::min(kShares * std::size_t(parallelThreads()), kMostShares)))
    , numbers(positions)
    , elements(positions) {
  std::size_t const grain = std::clamp(positions / shares, kLeastGrain, kMostGrain);
  for (std::size_t begin = 0; begin < positions; begin += grain) begins.push_back(begin);
  begins.push_back(positions);
  ends.resize(chunks() * shares);
}

ScatteredElements findScattered(VolumeData& volume, FieldSlot& slot, std::span<int3 const> positions,
                                ChunkTilesBegin chunkTiles) {
  volume.prepareWrite(slot);
  ScatteredElements out(positions.size());
  sortByShares(positions, out);

  std::vector<std::unique_ptr<Share>> shares(out.shares);
  std::vector<std::unique_ptr<ChunkTiles>> tiles(out.shares);
  VLN::Internal::Rollback made([&, groups = slot.pendingGroups()] {
    for (auto const& its : tiles)
      if (its) its->takeOut();
    slot.dropGroups(groups);
  });
  parallelFor(0, static_cast<std::int64_t>(out.shares), [&](std::int64_t begin, std::int64_t end) {
    for (auto s = begin; s < end; ++s) {
      tiles[s] = chunkTiles(0);
      shares[s] = std::make_unique<Share>(slot.blocks, *tiles[s]);
      for (std::size_t c = 0; c < out.chunks(); ++c)
        shares[s]->find(positions.data() + out.begins[c], out.numbersOf(c, s),
                        out.elements.data() + out.begin(c, s));
    }
  });
  int3 const* outside = nullptr;
  for (auto const& share : shares)
    if (share->outside && (!outside || share->outside < outside)) outside = share->outside;
  if (outside) throwOutside(*outside);
  takeMade(volume, slot, shares, tiles);
  made.dismiss();
  return out;
}

} // namespace VLN::TileTree3D::Internal
