// BulkRuns: many positions, grouped so that threads may write their elements without meeting.
#pragma once

#include "GeometryVolume/channels/PartPlacesImpl.h"
#include "GeometryVolume/core/FunctionRef.h"
#include "GeometryVolume/pools/Jemalloc.h"
#include "GeometryVolume/volume/detail/VolumeData.h"

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <new>
#include <span>
#include <vector>

namespace VLN::TileTree3D::Internal {

/// How many blocks before its turn one is fetched.
inline constexpr std::size_t kAhead = 8;

/// Consecutive positions in one block. They are a row, each one sample behind the one before it along an
/// axis, or loose.
struct BulkRun {
  static constexpr std::uint8_t kLoose = 3;

  FieldBlock const* block;
  std::uint32_t begin; ///< from the chunk's first position
  std::uint8_t count, axis;
  std::uint8_t slot, element; ///< of a row's first position
};

/// Of lists as long as the positions. What is long comes from the bulk allocator, which keeps its pages from
/// call to call: the heap gives them back to the system, which has to clear them anew each time.
template <class T> struct BulkListAllocator {
  using value_type = T;

  BulkListAllocator() = default;
  template <class U> explicit BulkListAllocator(BulkListAllocator<U> const&) {}
  /// @error std::bad_alloc.
  T* allocate(std::size_t n) {
    if (!isLong(n)) return std::allocator<T>().allocate(n);
    void* const block = allocate_jemalloc(n, sizeof(T));
    if (!block) throw std::bad_alloc();
    return static_cast<T*>(block);
  }
  void deallocate(T* block, std::size_t n) noexcept {
    if (isLong(n))
      deallocate_jemalloc(block);
    else
      std::allocator<T>().deallocate(block, n);
  }
  /// Elements without a value stay unwritten.
  void construct(T*) const {}
  bool operator==(BulkListAllocator const&) const { return true; }

private:
  static constexpr bool isLong(std::size_t n) { return n * sizeof(T) >= 128 << 10; }
};
template <class T> using BulkList = std::vector<T, BulkListAllocator<T>>;
using BulkRunList = BulkList<BulkRun>;

/// Tiles that a chunk of positions makes for itself and writes at once, where the field has no tiles near.
/// @threads One at a time.
struct ChunkTiles {
  explicit ChunkTiles(ArrayAhead its)
      : values(its) {}
  virtual ~ChunkTiles();
  /// Makes elements, with the values that are read there.
  /// @param tiles Their block gets them.
  virtual void make(BlockTiles const& tiles) = 0;
  /// Writes runs that begin at these places and values of the chunk.
  virtual void write(std::span<BulkRun const> runs, BulkPlace const* places) const = 0;
  /// Takes its tiles out of the field's blocks.
  virtual void takeOut() noexcept = 0;

  ArrayAhead const values; ///< of the chunk
};

/// Blocks that a chunk of positions made because the field had none there, or lacked tiles of them.
struct ChunkBlocks {
  FieldBlocks own;    ///< with tiles of the chunk's ChunkTiles
  FieldBlocks listed; ///< what lies in them is only listed: the field makes it for all chunks together
};

/// Runs that are left to be written, by chunks of positions and by shares; those of one block in the order of
/// the positions. A block belongs to one share: whoever writes each share chunk by chunk writes what comes
/// last last, whatever the number of shares.
struct BulkRuns {
  std::vector<std::size_t> begins; ///< of the chunks, and the end
  std::size_t shares = 1;
  BulkList<BulkPlace> places; ///< of loose positions
  std::vector<BulkRunList> lists;
  std::vector<ChunkBlocks> made; ///< for each chunk

  std::size_t chunks() const { return begins.size() - 1; }
  /// Which share writes a block. Shares are made of cubes of 32 samples: small enough to balance, and wide
  /// enough that positions in order are read in order.
  std::size_t shareOf(int3 const& at) const {
    auto const x = static_cast<std::uint32_t>(at.x) >> 5, y = static_cast<std::uint32_t>(at.y) >> 5,
               z = static_cast<std::uint32_t>(at.z) >> 5;
    return (x + 3 * y + 5 * z) % static_cast<std::uint32_t>(shares);
  }
  BulkRunList& list(std::size_t chunk, std::size_t share) { return lists[chunk * shares + share]; }
  BulkRunList const& list(std::size_t chunk, std::size_t share) const {
    return lists[chunk * shares + share];
  }
};

/// Begins the own tiles of a chunk whose first position has this number. Any thread may call it.
using ChunkTilesBegin = FunctionRef<std::unique_ptr<ChunkTiles>(std::size_t)>;

/// For positions in order of some kind: makes the tiles that are missing, writes those that one chunk alone
/// writes, and groups the positions that are left to be written.
/// @error std::out_of_range beyond the domain. What is thrown leaves all values as they were.
VLN_API BulkRuns planBulk(VolumeData& volume, FieldSlot& slot, std::span<int3 const> positions,
                          ChunkTilesBegin chunkTiles);

/// Whether positions go to another block nearly each time.
VLN_API bool isAtRandom(std::span<int3 const> positions);

/// Elements at random positions. Those of one block belong to one share, in the order of the positions.
struct VLN_API ScatteredElements {
  explicit ScatteredElements(std::size_t positions);

  std::size_t shares;
  std::vector<std::size_t> begins; ///< of the chunks of positions, and the end
  std::vector<std::size_t> ends;   ///< in the lists, of each share of each chunk
  BulkList<std::uint32_t> numbers; ///< of positions, from the chunk's first one
  BulkList<void*> elements;

  std::size_t chunks() const { return begins.size() - 1; }
  std::size_t begin(std::size_t chunk, std::size_t share) const {
    return share > 0 ? ends[chunk * shares + share - 1] : begins[chunk];
  }
  std::span<std::uint32_t const> numbersOf(std::size_t chunk, std::size_t share) const {
    std::size_t const first = begin(chunk, share);
    return {numbers.data() + first, ends[chunk * shares + share] - first};
  }
  template <class T> void write(std::size_t share, T const* values) const {
    for (std::size_t c = 0; c < chunks(); ++c) {
      std::size_t n = begin(c, share);
      for (std::uint32_t const number : numbersOf(c, share)) {
        __builtin_prefetch(elements[std::min(n + kElementsAhead, elements.size() - 1)], 1);
        *static_cast<T*>(elements[n++]) = values[begins[c] + number];
      }
    }
  }

private:
  static constexpr std::size_t kElementsAhead = 16;
};

/// Makes the tiles that are missing, and finds the elements of the positions.
/// @error As planBulk().
VLN_API ScatteredElements findScattered(VolumeData& volume, FieldSlot& slot, std::span<int3 const> positions,
                                        ChunkTilesBegin chunkTiles);

template <int kAxis, class T>
[[gnu::always_inline]] inline void writeRow(BulkRun const& row, T const* values) {
  constexpr std::size_t kStride = 1 << 2 * kAxis;
  auto const tile = [&](std::size_t slot) { return static_cast<T*>(row.block->tiles[slot].loadAcquire()); };
  std::size_t const element = row.element, slot = row.slot, slotBehind = slot + (1u << kAxis);
  if (row.count == 8) {
    T* const first = tile(slot) + element;
    T* const second = tile(slotBehind) + element;
    if constexpr (kAxis == 0) {
      std::copy_n(values, 4, first);
      std::copy_n(values + 4, 4, second);
    } else {
      for (std::size_t n = 0; n < 4; ++n) first[n * kStride] = values[n];
      for (std::size_t n = 0; n < 4; ++n) second[n * kStride] = values[4 + n];
    }
    return;
  }
  std::size_t const along = element / kStride & 3, count = row.count, inTile = std::min(count, 4 - along);
  T* to = tile(slot) + element;
  for (std::size_t n = 0; n < inTile; ++n) to[n * kStride] = values[n];
  if (count == inTile) return;
  to = tile(slotBehind) + element - along * kStride;
  for (std::size_t n = inTile; n < count; ++n) to[(n - inTile) * kStride] = values[n];
}

/// Writes the elements of a run, whose places and values these are.
template <class T>
[[gnu::always_inline]] inline void writeRun(BulkRun const& run, BulkPlace const* places, T const* values) {
  switch (run.axis) {
  case 0:
    return writeRow<0>(run, values);
  case 1:
    return writeRow<1>(run, values);
  case 2:
    return writeRow<2>(run, values);
  default:
    auto const& tiles = run.block->tiles;
    std::size_t const count = run.count;
    for (std::size_t n = 0; n < count; ++n)
      static_cast<T*>(tiles[places[n].slot].loadAcquire())[places[n].element] = values[n];
  }
}

} // namespace VLN::TileTree3D::Internal
