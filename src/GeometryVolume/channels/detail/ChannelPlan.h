// Bookkeeping of channel updates that no element type takes part in.
#pragma once

#include "GeometryVolume/core/Export.h"
#include "GeometryVolume/core/FixedArray.h"
#include "GeometryVolume/core/FunctionRef.h"
#include "GeometryVolume/tiletree/Traits.h"
#include "GeometryVolume/tiletree/TreeComponent.h"

#include <cstddef>
#include <cstdint>
#include <vector>

namespace VLN::TileTree3D::Internal {

using DepthCounts = PerDepth<std::int64_t, kChannelDepths>;

/// Elements from one tile's slot to the next in a static block: `elements` padded to whole cache lines. Slots
/// start on a cache line when the element size divides 64; other slots are only spaced apart.
VLN_API std::int64_t tileSlotStride(std::int64_t elements, std::size_t elementSize);

/// Blocks behind static tiles, each from the pool while that is enabled, else from the allocator. Frees them
/// when it goes.
class VLN_API BlockList {
public:
  BlockList() = default;
  ~BlockList() { clear(); }
  BlockList(BlockList const&) = delete;
  BlockList& operator=(BlockList const&) = delete;

  /// A further block, 64-byte aligned.
  /// @error Null when there is no memory for it.
  void* allocate(std::int64_t elements, std::size_t elementSize);
  /// The same of zeros, from the allocator alone: what the pool has was written before.
  void* allocateZeros(std::int64_t elements, std::size_t elementSize);
  /// A block as allocate() makes it; of zeros where `zeros` asks for that and it takes no writing.
  /// @param zeros Tells afterwards whether it is.
  void* allocate(std::int64_t elements, std::size_t elementSize, bool& zeros);
  /// Takes all blocks of another list. Needs no memory.
  void take(BlockList& from) noexcept;
  void clear();
  bool empty() const { return m_size == 0; }
  std::size_t size() const { return m_size; }

private:
  using Source = FunctionRef<void*(std::uint64_t elements, std::uint64_t elementSize)>;
  void* add(std::int64_t elements, std::size_t elementSize, Source source);

  struct Entry {
    void* block = nullptr;
    Entry* next = nullptr;
  };
  Entry* m_first = nullptr;
  std::size_t m_size = 0;
};
/// Appends `from` to `into` and empties it.
/// @threads Several threads may hand blocks to one list.
VLN_API void handOverBlocks(BlockList& into, BlockList& from) noexcept;

/// Source of the counts that a channel is brought into step with.
class TileCounts {
public:
  virtual std::int64_t tileCount(int depth) const = 0;
  virtual std::int64_t elementCount(TreeIndex const& tile) const = 0;

protected:
  ~TileCounts() = default;
};

class ComponentCounts final : public TileCounts {
public:
  explicit ComponentCounts(Component const& component)
      : m_component(component) {}
  std::int64_t tileCount(int depth) const override { return m_component.tileCount(depth); }
  std::int64_t elementCount(TreeIndex const& tile) const override { return m_component.elementCount(tile); }

private:
  Component const& m_component;
};

/// A run of tiles at each depth, counted through from depth 0 so that one flat loop covers them all.
class VLN_API TileSpans {
public:
  TileSpans() { m_ends.fill(0); }
  /// Adds the tiles [begin, end) of a depth.
  /// @pre Depths are added rising, each at most once.
  void add(int depth, std::int64_t begin, std::int64_t end);
  std::int64_t total() const { return m_ends.back(); }

  /// Calls `body(depth, begin, end)` in parallel for pieces that cover all runs.
  void forEach(std::int64_t grain, FunctionRef<void(int, std::int64_t, std::int64_t)> body) const;

private:
  DepthCounts m_begins{};
  /// Running totals of tiles through each depth.
  DepthCounts m_ends;
};

/// Where tiles lie in a static block, in elements from its start.
struct TileSlots {
  PerDepth<std::vector<std::int64_t>, kChannelDepths> offsets;
  std::int64_t total = 0;

  std::int64_t at(int depth, std::int64_t tile) const { return offsets[depth][tile]; }
};
/// Slots one behind the other for the first `counts[d]` tiles of each depth. Tiles without elements take
/// none; `slotOf(elements)` gives the room of the others.
VLN_API TileSlots planSlots(int first, int last, DepthCounts const& counts,
                            FunctionRef<std::size_t(int depth, std::int64_t tile)> elements,
                            FunctionRef<std::int64_t(std::size_t elements)> slotOf);

/// How a channel comes into step with other tile counts.
struct GrowthPlan {
  /// The added tiles of a depth: those of one size lie in the block from `base` on, a stride apart; others at
  /// offsets of their own.
  struct Tiles {
    static constexpr std::int64_t kDiffer = -1;
    std::int64_t elements = kDiffer; ///< of each; not asked for without a block
    std::int64_t base = 0, stride = 0;
  };
  bool changes = false;
  DepthCounts wanted{};
  TileSpans added;
  PerDepth<Tiles, kChannelDepths> tiles;
  TileSlots slots;
  std::int64_t blockElements = 0;
};
/// @param fixedElements Of tiles of fixed size; 0 where each has what `source` says.
/// @param stride 0 without a block, else the slot of a tile of fixed size. Other tiles lie one behind the
/// other.
VLN_API GrowthPlan planGrowth(int first, int last, DepthCounts const& own, TileCounts const& source,
                              std::int64_t fixedElements, std::int64_t stride);

/// Whether each list of the depths [first, last] is empty or names every tile once.
VLN_API bool isPermutation(std::vector<std::vector<std::int64_t>> const& lists, int first, int last,
                           DepthCounts const& counts);

/// Tiles of `bytes` each that are worth a task of their own.
inline std::int64_t tileGrain(std::size_t bytes) {
  return bytes >= 32768 ? 1 : static_cast<std::int64_t>(32768 / (bytes + 64)) + 1;
}

/// Runs `body(depth)` for each depth of [first, last] in parallel.
VLN_API void forEachDepth(int first, int last, FunctionRef<void(int)> body);

} // namespace VLN::TileTree3D::Internal
