// Writing many elements: which lie in which block, and which tiles are missing.
#include "GeometryVolume/volume/FieldBulk.h"
#include "GeometryVolume/core/Parallel.h"

#include <algorithm>
#include <stdexcept>
#include <string>

namespace VLN::TileTree3D::Internal {

namespace {

/// The runs of a chunk of positions, and the tiles that they lack, each once.
struct Chunk {
  std::vector<BulkRun> runs;
  std::vector<int3> missing;
  std::int64_t outside = -1;
};

/// A first pass over an empty volume finds the tiles of each row again and again: what a chunk has listed it
/// need not list once more, and large chunks list less.
Chunk findRuns(FieldBlocks const& blocks, std::span<int3 const> positions, std::int64_t begin,
               std::int64_t end) {
  Chunk out;
  FieldBlocks listed;
  FieldBlock* block = nullptr;
  FieldBlock* listedBlock = nullptr;
  int3 at{0, 0, 0};
  for (auto n = begin; n < end; ++n) {
    int3 const& p = positions[static_cast<std::size_t>(n)];
    if (!block || static_cast<std::uint32_t>((p.x ^ at.x) | (p.y ^ at.y) | (p.z ^ at.z)) >=
                      std::uint32_t(FieldBlock::kWidth)) {
      if (!VolumeShape::inDomain(p.x, p.y, p.z)) {
        out.outside = n;
        return out;
      }
      at = {p.x & ~7, p.y & ~7, p.z & ~7};
      block = blocks.find(p.x, p.y, p.z);
      listedBlock = nullptr;
      out.runs.push_back({block, n, 0});
    }
    ++out.runs.back().count;
    std::size_t const slot = FieldBlock::slot(p.x, p.y, p.z);
    if (block->tiles[slot]) continue;
    if (!listedBlock) listedBlock = listed.find(p.x, p.y, p.z);
    if (listedBlock->tiles[slot]) continue;
    listed.insert(p, &out);
    listedBlock = listed.find(p.x, p.y, p.z);
    out.missing.push_back({p.x & ~3, p.y & ~3, p.z & ~3});
  }
  return out;
}

std::vector<Chunk> findRuns(FieldBlocks const& blocks, std::span<int3 const> positions) {
  auto const n = static_cast<std::int64_t>(positions.size());
  std::int64_t const grain = std::clamp<std::int64_t>(n / 16, 16384, 1 << 20);
  std::vector<Chunk> chunks(static_cast<std::size_t>(chunkCount(0, n, grain)));
  parallelChunks(0, n, grain, [&](std::int64_t chunk, std::int64_t begin, std::int64_t end) {
    chunks[static_cast<std::size_t>(chunk)] = findRuns(blocks, positions, begin, end);
  });
  for (Chunk const& chunk : chunks) {
    if (chunk.outside < 0) continue;
    int3 const& p = positions[static_cast<std::size_t>(chunk.outside)];
    throw std::out_of_range("(" + std::to_string(p.x) + ", " + std::to_string(p.y) + ", " +
                            std::to_string(p.z) + ") lies outside the domain of a volume");
  }
  return chunks;
}

std::size_t bucketOf(FieldBlock const* block) {
  return (reinterpret_cast<std::uintptr_t>(block) >> 6) * 0x9e3779b97f4a7c15ull >> 56;
}

} // namespace

BulkRuns planBulk(VolumeData& volume, FieldSlot& slot, std::span<int3 const> positions) {
  volume.prepareWrite(slot);
  auto chunks = findRuns(slot.blocks, positions);
  if (std::any_of(chunks.begin(), chunks.end(), [](Chunk const& c) { return !c.missing.empty(); })) {
    VolumeTree::TileLists lists;
    auto& finest = lists[static_cast<std::size_t>(VolumeShape::kMaxDepth)];
    for (Chunk const& chunk : chunks)
      for (int3 const& p : chunk.missing) finest.append(p);
    volume.makeTiles(lists);
    volume.prepareWrite(slot);
    // Blocks that were there have their new tiles; the others are looked up again.
    parallelFor(0, static_cast<std::int64_t>(chunks.size()), [&](std::int64_t begin, std::int64_t end) {
      for (auto c = begin; c < end; ++c)
        for (BulkRun& run : chunks[static_cast<std::size_t>(c)].runs) {
          if (run.block != FieldBlocks::noBlock()) continue;
          int3 const& p = positions[static_cast<std::size_t>(run.begin)];
          run.block = slot.blocks.find(p.x, p.y, p.z);
        }
    });
  }
  BulkRuns out;
  if (parallelThreads() == 1) {
    out.ends.assign(1, 0);
    for (Chunk const& chunk : chunks) out.runs.insert(out.runs.end(), chunk.runs.begin(), chunk.runs.end());
    out.ends[0] = out.runs.size();
    return out;
  }
  // A stable sort by bucket.
  using Counts = std::array<std::size_t, BulkRuns::kBuckets>;
  std::vector<Counts> starts(chunks.size());
  auto const forEachChunk = [&](FunctionRef<void(Chunk const&, Counts&)> body) {
    parallelFor(0, static_cast<std::int64_t>(chunks.size()), [&](std::int64_t begin, std::int64_t end) {
      for (auto c = static_cast<std::size_t>(begin); c < static_cast<std::size_t>(end); ++c)
        body(chunks[c], starts[c]);
    });
  };
  forEachChunk([](Chunk const& chunk, Counts& counts) {
    counts.fill(0);
    for (BulkRun const& run : chunk.runs) ++counts[bucketOf(run.block)];
  });
  std::size_t sum = 0;
  for (std::size_t b = 0; b < BulkRuns::kBuckets; ++b) {
    for (Counts& counts : starts) sum += std::exchange(counts[b], sum);
    out.ends.push_back(sum);
  }
  out.runs.resize(sum);
  forEachChunk([&](Chunk const& chunk, Counts& next) {
    for (BulkRun const& run : chunk.runs) out.runs[next[bucketOf(run.block)]++] = run;
  });
  return out;
}

} // namespace VLN::TileTree3D::Internal
