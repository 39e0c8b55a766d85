// FieldBlocks: where the finest tiles of one field lie in memory, by position.
//
//   slots of a hash table          blocks of 8 x 8 x 8 samples
//   [corner | block] ------------> [ * * 0 * 0 0 0 * ]    a pointer for each tile of 4 x 4 x 4, null where
//   [corner | block]                 |                     the field has none
//                                    '--> 64 elements
//
// Unlike the tables of a ChannelReader these grow with the field, a tile at a time.
#pragma once

#include "GeometryVolume/channels/detail/BlockPlaces.h"
#include "GeometryVolume/core/Export.h"
#include "GeometryVolume/core/detail/Atomic.h"
#include "Velorn/Math.h"

#include <array>
#include <cstddef>
#include <cstdint>
#include <vector>

namespace VLN::TileTree3D::Internal {

using Velorn::Math::int3;

/// Tiles as slots of their parent, i fastest. A block stays where it is for as long as its table lives.
/// @threads A reader may look for a tile while another thread enters it.
struct alignas(64) FieldBlock {
  static constexpr int kWidth = 8;
  using Entry = VLN::Internal::Atomic<void*>;
  std::array<Entry, 8> tiles{};

  using Places = BlockPlaces<2, 4, 4, 0>;
  using Place = Places::Place;
  static Place place(int i, int j, int k) {
    return Places::find(std::uint32_t(i) % kWidth, std::uint32_t(j) % kWidth, std::uint32_t(k) % kWidth);
  }
  /// The low corner of a tile of the block that holds `position`.
  static int3 tileCorner(int3 const& position, std::size_t slot) {
    auto const n = static_cast<int>(slot);
    return {(position.x & ~7) + (n & 1) * 4, (position.y & ~7) + (n >> 1 & 1) * 4,
            (position.z & ~7) + (n >> 2) * 4};
  }
  /// The tile that holds a sample, or null.
  void* tile(Place at) const { return tile(at.slot()); }
  void* tile(std::size_t slot) const { return tiles[slot].loadAcquire(); }
  void* tile(int i, int j, int k) const { return tile(place(i, j, k)); }
};

/// Some tiles of the block that holds a position: bit n stands for slot n.
struct BlockTiles {
  int3 position;
  std::uint32_t slots;
  FieldBlock* block = nullptr; ///< of the table that they are looked for in
};

/// @threads As a container of the standard library.
class VLN_API FieldBlocks {
public:
  /// What a block is looked up by: its place among blocks, and where the search begins in any table.
  struct Key {
    explicit Key(int3 const& position)
        : at{position.x >> 3, position.y >> 3, position.z >> 3} {
      std::uint64_t h = static_cast<std::uint32_t>(at.x) * 0x9e3779b97f4a7c15ull;
      h ^= (static_cast<std::uint32_t>(at.y) * 0xc2b2ae3d27d4eb4full) ^
           (static_cast<std::uint32_t>(at.z) * 0x165667b19e3779f9ull);
      hash = static_cast<std::uint32_t>((h ^ h >> 32) * 0xd6e8feb86659fd93ull >> 32);
    }

    int3 at;
    std::uint32_t hash;
  };

  /// The block that holds the position; noBlock() where there is none.
  FieldBlock* find(int i, int j, int k) const { return find(Key({i, j, k})); }
  FieldBlock* find(Key const& key) const {
    FieldBlock* const found = look(key);
    return found ? found : noBlock();
  }
  /// The same; null where there is none.
  FieldBlock* look(Key const& key) const {
    for (std::size_t n = key.hash & m_mask;; n = (n + 1) & m_mask) {
      Slot const& slot = m_slots[n];
      if (!slot.block || slot.key.at == key.at) return slot.block;
    }
  }
  /// The elements of the tile at a position, or null.
  void* tile(int i, int j, int k) const { return find(i, j, k)->tile(i, j, k); }
  /// The block that holds the position, made where there is none.
  FieldBlock& make(int3 const& position) { return make(position, nullptr); }
  /// The same where the table has none, or `block`, which it has taken over, instead of a new one.
  FieldBlock& make(int3 const& position, FieldBlock* block);
  /// Takes over the memory of another table's blocks, which is empty then.
  void takeMemory(FieldBlocks& other);
  /// The tile at a position, to be entered. It stays where it is.
  FieldBlock::Entry& entry(int3 const& position) {
    return make(position).tiles[FieldBlock::place(position.x, position.y, position.z).slot()];
  }
  /// Fetches what find() and make() look at.
  void prefetch(int3 const& position) const { prefetch(Key(position)); }
  void prefetch(Key const& key) const { __builtin_prefetch(&m_slots[key.hash & m_mask]); }
  void clear();
  /// Makes room, so that making `blocks` blocks more moves no slots.
  void reserve(std::size_t blocks);
  /// A block without tiles, the same for all tables. Nothing writes it.
  static FieldBlock* noBlock();

private:
  struct Slot {
    Key key{{0, 0, 0}};
    FieldBlock* block = nullptr;
  };
  static constexpr std::size_t kFirstChunk = 8, kMostChunk = 256;

  void resize(std::size_t slots);
  FieldBlock& newBlock();

  std::vector<Slot> m_slots = std::vector<Slot>(16);
  std::size_t m_mask = 15, m_used = 0;
  std::vector<std::vector<FieldBlock>> m_chunks; ///< none grows: blocks stay where they are
  std::size_t m_left = 0;                        ///< blocks of the last chunk that are not in use
};

} // namespace VLN::TileTree3D::Internal
