// Writing many elements whose positions are in order of some kind: chunks of positions find their runs, and
// the field gets the tiles that they need. (Random positions: FieldScatter.cpp.)
//
// A round of chunks, one for each thread or all that are left:
//
//   each chunk   finds runs for the shares, writes own blocks, lists missing tiles (RunFinder)
//   the field    takes the own blocks; what several chunks wrote is listed to be written again, in order
//                makes the missing tiles
#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/core/RollbackImpl.h"
#include "GeometryVolume/volume/FieldBulkImpl.h"
#include "GeometryVolume/volume/RunFinderImpl.h"

#include <algorithm>
#include <array>
#include <cstddef>
#include <random>
#include <utility>

namespace VLN::TileTree3D::Internal {

ChunkTiles::~ChunkTiles() = default;

namespace {

/// Chunks for each thread, and positions in one.
constexpr std::size_t kChunks = 16, kLeastGrain = 16384, kMostGrain = 1 << 20;
/// Where one of so many of its blocks is another chunk's too, the chunks that follow make none for
/// themselves.
constexpr std::size_t kShared = 8;

/// The axis along which positions in order go from block to block and never back, or -1.
int slowestAxis(std::span<int3 const> positions) {
  constexpr std::size_t kSamples = 16;
  // One anywhere in each part: where steps are even and happen to be whole rows or planes, faster axes would
  // seem to stand.
  std::array<std::size_t, kSamples> samples;
  std::minstd_rand random;
  for (std::size_t n = 0; n < kSamples; ++n) {
    std::size_t const begin = n * positions.size() / kSamples, end = (n + 1) * positions.size() / kSamples;
    samples[n] = begin + random() % std::max<std::size_t>(end - begin, 1);
  }
  int out = -1;
  std::size_t fewest = kSamples + 1;
  for (int axis = 0; axis < 3; ++axis) {
    std::size_t ups = 0, downs = 0;
    int last = positions[0][axis] >> 3;
    for (std::size_t const sample : samples) {
      int const at = positions[sample][axis] >> 3;
      ups += at > last, downs += at < last;
      last = at;
    }
    if (ups + downs > 0 && ups * downs == 0 && ups + downs < fewest) fewest = ups + downs, out = axis;
  }
  return out;
}

/// Where chunks of some `grain` positions begin, and the end. Those of positions in order meet between
/// blocks.
std::vector<std::size_t> chunkBegins(std::span<int3 const> positions, std::size_t grain) {
  constexpr std::size_t kMostGrains = 4, kBlockSamples = 512;
  std::vector<std::size_t> out{0};
  for (std::size_t left; left = positions.size() - out.back(), left > 2 * grain;) {
    auto const next = positions.subspan(out.back() + grain / 2, std::min(kMostGrains * grain, left - grain));
    std::size_t at = grain / 2;
    if (int const axis = slowestAxis(next); axis >= 0) {
      int const block = next[0][axis] >> 3;
      auto const change = std::partition_point(next.begin(), next.end(),
                                               [&](int3 const& p) { return p[axis] >> 3 == block; });
      if (change != next.end()) at = static_cast<std::size_t>(change - next.begin());
    }
    int3 const corner = cornerOf(next[at - 1]);
    for (std::size_t const end = std::min(at + kBlockSamples, next.size());
         at < end && inBlock(corner, next[at]);)
      ++at;
    out.push_back(out.back() + grain / 2 + at);
  }
  if (!positions.empty()) out.push_back(positions.size());
  return out;
}

/// Lets chunks find their runs, round by round, and gives the field what they need.
class Planner {
public:
  Planner(VolumeData& volume, FieldSlot& slot, std::span<int3 const> positions, BulkRuns& out)
      : m_volume(volume)
      , m_slot(slot)
      , m_positions(positions)
      , m_out(out)
      , m_found(out.chunks()) {}

  /// Scattered positions ask for the same tiles over and over: rounds are each as long as all before it then,
  /// and what the first ones have made is not listed again.
  void plan(ChunkTilesBegin chunkTiles) {
    std::size_t const chunks = m_out.chunks();
    for (m_last = m_out.shares; m_first < chunks;
         m_first = m_last, m_last = m_isScattered ? 2 * m_last : chunks) {
      m_last = std::min(m_last, chunks);
      findRuns(chunkTiles);
      takeOwn();
      makeMissing();
    }
  }

private:
  /// The chunks of the round, in parallel.
  void forEachChunk(FunctionRef<void(std::size_t)> body) const {
    parallelFor(static_cast<std::int64_t>(m_first), static_cast<std::int64_t>(m_last),
                [&](std::int64_t begin, std::int64_t end) {
                  for (auto c = begin; c < end; ++c) body(static_cast<std::size_t>(c));
                });
  }
  std::span<Chunk> round() { return std::span(m_found).subspan(m_first, m_last - m_first); }

  void findRuns(ChunkTilesBegin chunkTiles) {
    m_tiles.clear();
    m_tiles.resize(m_last - m_first);
    forEachChunk([&](std::size_t c) {
      std::size_t const begin = m_out.begins[c];
      auto const positions = m_positions.subspan(begin, m_out.begins[c + 1] - begin);
      // The thread's own until they are full: lists of neighbours share lines of the cache.
      std::vector<BulkRunList> lists(m_out.shares + 1);
      // Enough for short rows.
      for (auto& list : lists) list.reserve(positions.size() / (2 * m_out.shares));
      auto& tiles = m_tiles[c - m_first] = chunkTiles(begin);
      m_found[c] = RunFinder(m_slot.blocks, m_out.made[c], m_out, *tiles, lists.data())
                       .find(positions, &m_out.places[begin], m_isScattered);
      std::move(lists.begin(), lists.end() - 1, &m_out.list(c, 0));
    });
    for (Chunk const& chunk : round()) {
      if (chunk.outside) throwOutside(*chunk.outside);
      m_isScattered = m_isScattered || chunk.isScattered;
    }
  }

  /// Gives the field the blocks and tiles that the chunks have made for themselves.
  void takeOwn() {
    std::size_t count = 0;
    bool listsBlocks = false; // which may be others' own
    for (Chunk const& chunk : round()) {
      count += chunk.own.size();
      listsBlocks = listsBlocks || chunk.listsBlocks;
    }
    if (count == 0) return;
    std::size_t const groups = m_slot.pendingGroups();
    m_slot.adopt(m_volume, m_tiles);
    m_slot.blocks.reserve(count);
    m_shared.clear();
    for (std::size_t c = m_first; c < m_last; ++c) enterOwn(c);
    std::sort(m_shared.begin(), m_shared.end());
    // What several chunks have written, or another one lists, is written again, in order.
    if (listsBlocks || !m_shared.empty())
      forEachChunk([&](std::size_t c) {
        for (BulkRun const& run : m_found[c].ownRuns)
          if (listsBlocks || std::binary_search(m_shared.begin(), m_shared.end(), run.block))
            m_out.list(c, m_out.shareOf(m_positions[m_out.begins[c] + run.begin])).push_back(run);
      });
    if (!m_shared.empty()) m_slot.dropUnentered(groups);
    m_isScattered = m_isScattered || m_shared.size() * kShared > count;
  }
  /// Each block keeps the tiles that its runs are in; of those that several chunks have made it gets the
  /// first.
  void enterOwn(std::size_t chunk) {
    FieldBlocks& blocks = m_slot.blocks;
    auto const& own = m_found[chunk].own;
    blocks.takeMemory(m_out.made[chunk].own);
    for (std::size_t n = 0; n < own.size(); ++n) {
      if (n + kAhead < own.size()) blocks.prefetch(own[n + kAhead].position);
      FieldBlock& mine = *own[n].block;
      FieldBlock& block = blocks.make(own[n].position, &mine);
      if (&block == &mine) continue;
      bool isShared = false;
      for (std::size_t k = 0; k < block.tiles.size(); ++k) {
        void *const tile = mine.tiles[k].loadRelaxed(), *const first = block.tiles[k].loadRelaxed();
        if (tile && !first) block.tiles[k].storeRelease(tile);
        if (tile && first) mine.tiles[k].storeRelease(first), isShared = true;
      }
      if (isShared) m_shared.insert(m_shared.end(), {&mine, &block});
    }
  }

  void makeMissing() {
    std::vector<BlockTiles> missing;
    for (Chunk const& chunk : round())
      missing.insert(missing.end(), chunk.missing.begin(), chunk.missing.end());
    if (missing.empty()) return;
    m_slot.makePending(m_volume, missing);
    // The chunks' blocks get them too: runs lead there.
    std::vector<BlockTiles const*> made{missing.data()};
    for (Chunk const& chunk : round()) made.push_back(made.back() + chunk.missing.size());
    forEachChunk([&](std::size_t c) {
      BlockTiles const* next = made[c - m_first];
      for (BlockTiles const& copy : m_found[c].missing) {
        FieldBlock const& block = *next++->block;
        for (std::size_t k = 0; k < block.tiles.size(); ++k)
          copy.block->tiles[k].storeRelaxed(block.tiles[k].loadAcquire());
      }
    });
  }

  VolumeData& m_volume;
  FieldSlot& m_slot;
  std::span<int3 const> m_positions;
  BulkRuns& m_out;
  std::vector<Chunk> m_found;
  std::size_t m_first = 0, m_last = 0; ///< chunks of the round
  std::vector<std::unique_ptr<ChunkTiles>> m_tiles;
  std::vector<FieldBlock const*> m_shared; ///< in order: blocks with tiles that several chunks have made
  bool m_isScattered = false;
};

} // namespace

BulkRuns planBulk(VolumeData& volume, FieldSlot& slot, std::span<int3 const> positions,
                  ChunkTilesBegin chunkTiles) {
  volume.prepareWrite(slot);
  BulkRuns out;
  out.shares = static_cast<std::size_t>(parallelThreads());
  out.begins =
      chunkBegins(positions, std::clamp(positions.size() / (kChunks * out.shares), kLeastGrain, kMostGrain));
  out.lists.resize(out.chunks() * out.shares);
  out.made.resize(out.chunks());
  out.places.resize(positions.size());
  VLN::Internal::Rollback made([&, groups = slot.pendingGroups()] { slot.dropGroups(groups); });
  Planner(volume, slot, positions, out).plan(chunkTiles);
  made.dismiss();
  return out;
}

} // namespace VLN::TileTree3D::Internal
