// Writing many elements: which lie in which block, and which tiles are missing.
#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/volume/FieldBulkImpl.h"

#include <algorithm>

namespace VLN::TileTree3D::Internal {

namespace {

/// What a chunk of positions lacks, each tile once.
struct Chunk {
  std::vector<int3> missing;
  std::int64_t outside = -1;
};

/// Which share writes a block. Shares are made of cubes of 32 samples: small enough to balance, and wide
/// enough that positions in order are read in order.
std::size_t shareOf(int3 const& at, std::size_t shares) {
  auto const x = static_cast<std::uint32_t>(at.x) >> 5, y = static_cast<std::uint32_t>(at.y) >> 5,
             z = static_cast<std::uint32_t>(at.z) >> 5;
  return (x + 3 * y + 5 * z) % shares;
}

/// A first pass over an empty volume finds the tiles of each row again and again: what a chunk has listed it
/// need not list once more, and large chunks list less.
/// @param lists One for each share.
Chunk findRuns(FieldBlocks const& blocks, std::span<int3 const> positions, std::int64_t begin,
               std::int64_t end, std::size_t shares, std::vector<BulkRun>* lists) {
  Chunk out;
  BulkRun* run = nullptr;
  FieldBlocks listed;
  FieldBlock* block = nullptr;
  FieldBlock* listedBlock = nullptr;
  int3 at{0, 0, 0}, tile{0, 0, 0};
  auto const holds = [](int3 const& corner, int width, int3 const& p) {
    return static_cast<std::uint32_t>((p.x ^ corner.x) | (p.y ^ corner.y) | (p.z ^ corner.z)) <
           static_cast<std::uint32_t>(width);
  };
  std::int64_t runBegin = begin;
  auto const endRun = [&](std::int64_t n) {
    if (run) run->count = n - runBegin;
  };
  for (auto n = begin; n < end; ++n) {
    int3 const& p = positions[static_cast<std::size_t>(n)];
    if (run && holds(tile, 4, p)) continue;
    if (!run || !holds(at, FieldBlock::kWidth, p)) {
      if (!VolumeShape::inDomain(p)) {
        out.outside = n;
        return out;
      }
      endRun(n);
      at = {p.x & ~7, p.y & ~7, p.z & ~7};
      block = blocks.find(p.x, p.y, p.z);
      listedBlock = nullptr;
      auto& list = lists[shareOf(at, shares)];
      list.push_back({block, n, 0});
      run = &list.back();
      runBegin = n;
    }
    tile = {p.x & ~3, p.y & ~3, p.z & ~3};
    auto const place = FieldBlock::place(p.x, p.y, p.z);
    if (block->tile(place)) continue;
    if (!listedBlock) listedBlock = listed.find(p.x, p.y, p.z);
    if (listedBlock->tile(place)) continue;
    listed.entry(p).storeRelaxed(&out);
    listedBlock = listed.find(p.x, p.y, p.z);
    out.missing.push_back(tile);
  }
  endRun(end);
  return out;
}

} // namespace

BulkRuns planBulk(VolumeData& volume, FieldSlot& slot, std::span<int3 const> positions) {
  volume.prepareWrite(slot);
  auto const n = static_cast<std::int64_t>(positions.size());
  std::int64_t const grain = std::clamp<std::int64_t>(n / 16, 16384, 1 << 20);
  std::int64_t const chunks = chunkCount(0, n, grain);
  BulkRuns out;
  out.shares = static_cast<std::size_t>(parallelThreads());
  out.lists.resize(static_cast<std::size_t>(chunks) * out.shares);
  std::vector<Chunk> found(static_cast<std::size_t>(chunks));
  // Round by round, each as long as all before it: positions at random ask for the same tiles over and over,
  // and those that the first rounds have made are not listed again.
  for (std::int64_t first = 0, last = 1; first < chunks; first = last, last *= 2) {
    last = std::min(last, chunks);
    auto const forEachChunk = [&](FunctionRef<void(std::size_t)> body) {
      parallelFor(first, last, [&](std::int64_t begin, std::int64_t end) {
        for (auto c = begin; c < end; ++c) body(static_cast<std::size_t>(c));
      });
    };
    forEachChunk([&](std::size_t c) {
      std::int64_t const begin = static_cast<std::int64_t>(c) * grain;
      found[c] = findRuns(slot.blocks, positions, begin, std::min(n, begin + grain), out.shares,
                          &out.lists[c * out.shares]);
    });
    std::vector<int3> missing;
    for (auto c = static_cast<std::size_t>(first); c < static_cast<std::size_t>(last); ++c) {
      if (found[c].outside >= 0) throwOutside(positions[static_cast<std::size_t>(found[c].outside)]);
      missing.insert(missing.end(), found[c].missing.begin(), found[c].missing.end());
    }
    if (missing.empty()) continue;
    slot.makePending(volume, missing);
    // Blocks that were there have their new tiles; the others are looked up again.
    forEachChunk([&](std::size_t c) {
      for (std::size_t list = c * out.shares; list < (c + 1) * out.shares; ++list)
        for (BulkRun& run : out.lists[list]) {
          if (run.block != FieldBlocks::noBlock()) continue;
          int3 const& p = positions[static_cast<std::size_t>(run.begin)];
          run.block = slot.blocks.find(p.x, p.y, p.z);
        }
    });
  }
  return out;
}

} // namespace VLN::TileTree3D::Internal
