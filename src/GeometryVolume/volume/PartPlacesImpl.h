// PartPlaces: where positions lie in their blocks, many at once, and where one block ends and the next
// begins.
#pragma once

#include "GeometryVolume/core/detail/SimdLanes.h"
#include "GeometryVolume/volume/detail/FieldBlocks.h"

#include <array>
#include <bit>
#include <cstddef>
#include <cstdint>
#include <cstring>

namespace VLN::TileTree3D::Internal {

/// A position in its block: which tile, and which of its elements.
struct BulkPlace {
  std::uint8_t element, slot;
};
static_assert(sizeof(BulkPlace) == 2 && std::endian::native == std::endian::little);

/// Some tiles of a block: those whose bit is set in any of eight bytes, bit n for slot n. So the tiles of
/// many positions come together in few steps.
struct SlotBytes {
  std::uint64_t bytes;

  static SlotBytes all() { return {~std::uint64_t(0)}; }
  std::uint32_t bits() const {
    std::uint64_t folded = bytes | bytes >> 32;
    folded |= folded >> 16;
    return static_cast<std::uint32_t>(folded | folded >> 8) & 0xffu;
  }
  /// @param others Hold the same in each byte.
  bool anyOf(SlotBytes others) const { return (bytes & others.bytes) != 0; }
  /// Takes slots out, where each byte holds the same.
  void drop(std::uint32_t slots) { bytes &= ~(slots * 0x0101010101010101u); }
};

/// An array that is read in order, and fetched ahead: no processor does that beyond a page of memory. It may
/// be fetched beyond its end.
struct ArrayAhead {
  std::uintptr_t begin;
  std::size_t elementSize;

  void fetch(std::size_t first, std::size_t count) const {
    for (std::size_t byte = 0; byte < count * elementSize; byte += 64)
      __builtin_prefetch(reinterpret_cast<void const*>(begin + first * elementSize + byte));
  }
};

/// What is found of a part of the positions.
class PartPlaces {
public:
  static constexpr std::uint32_t kMost = 1024, kAtOnce = 8;

  /// @param places Gets `count` of them.
  /// @param values What is fetched meanwhile, from the part's own on; empty for nothing.
  void find(int3 const* positions, std::size_t count, BulkPlace* places, ArrayAhead values) {
    ArrayAhead const ahead{reinterpret_cast<std::uintptr_t>(positions), sizeof(int3)};
    m_first.fill(0);
    Four last{};
    std::size_t n = 0;
    for (; n + kAtOnce <= count; n += kAtOnce) {
      ahead.fetch(kMost + n, kAtOnce);
      values.fetch(n, kAtOnce);
      findEight(positions + n, n, last, places + n);
    }
    if (n < count) {
      int3 rest[kAtOnce] = {};
      BulkPlace placesOfRest[kAtOnce];
      std::memcpy(rest, positions + n, (count - n) * sizeof(int3));
      findEight(rest, n, last, placesOfRest);
      std::memcpy(places + n, placesOfRest, (count - n) * sizeof(BulkPlace));
    }
    m_first[0] |= 1;
    std::uint32_t* start = m_starts.data();
    for (std::size_t word = 0; 64 * word < count; ++word)
      for (std::uint64_t left = m_first[word]; left; left &= left - 1)
        *start++ = static_cast<std::uint32_t>(64 * word) + static_cast<std::uint32_t>(std::countr_zero(left));
    while (start[-1] >= count) --start; // positions that filled the last eight
    *start = static_cast<std::uint32_t>(count);
  }
  /// Where positions in another block than the one before begin, and `count` behind them.
  std::uint32_t const* runStarts() const { return m_starts.data(); }
  /// The tiles that hold some positions.
  SlotBytes slotsOf(std::size_t first, std::size_t count) const {
    std::uint64_t all = 0;
    auto const eight = [from = m_slots.data() + first](std::size_t n) {
      std::uint64_t out;
      std::memcpy(&out, from + n, sizeof(out));
      return out;
    };
    std::size_t n = 0;
    for (; n + 8 <= count; n += 8) all |= eight(n);
    if (n < count) all |= eight(n) << (64 - 8 * (count - n));
    return {all};
  }

private:
  using Shorts = std::uint16_t __attribute__((vector_size(16)));
  using Bytes = std::uint8_t __attribute__((vector_size(8)));
  struct Four {
    UnsignedLanes x, y, z;
  };
  struct Eight {
    Four even, odd; ///< 0 2 4 6, 1 3 5 7
  };

  static Eight load(int3 const* p) {
    auto const at = [p](int pair, int word) {
      UnsignedLanes out;
      std::memcpy(&out, reinterpret_cast<char const*>(p + 2 * pair) + 4 * word, sizeof(out));
      return out;
    };
    auto const low = [](auto a, auto b) { return __builtin_shufflevector(a, b, 0, 4, 1, 5); };
    auto const high = [](auto a, auto b) { return __builtin_shufflevector(a, b, 2, 6, 3, 7); };
    auto const first = [](auto a, auto b) { return __builtin_shufflevector(a, b, 0, 1, 4, 5); };
    auto const second = [](auto a, auto b) { return __builtin_shufflevector(a, b, 2, 3, 6, 7); };
    // Pairs from their first word on are x y z x, from their third word on z x y z.
    UnsignedLanes const xy[2] = {low(at(0, 0), at(1, 0)), low(at(2, 0), at(3, 0))};
    UnsignedLanes const zx[2] = {high(at(0, 0), at(1, 0)), high(at(2, 0), at(3, 0))};
    UnsignedLanes const yz[2] = {high(at(0, 2), at(1, 2)), high(at(2, 2), at(3, 2))};
    return {{first(xy[0], xy[1]), second(xy[0], xy[1]), first(zx[0], zx[1])},
            {second(zx[0], zx[1]), first(yz[0], yz[1]), second(yz[0], yz[1])}};
  }
  /// Of lanes for every other position those for all: the even ones lie low.
  static Shorts mix(UnsignedLanes even, UnsignedLanes odd) {
    return reinterpret_cast<Shorts>((even & 0xffffu) | odd << 16);
  }
  static std::uint64_t bytesOf(Shorts v) {
    return std::bit_cast<std::uint64_t>(__builtin_convertvector(v, Bytes));
  }
  /// True lanes where two positions lie in different blocks.
  static UnsignedLanes differ(Four const& a, Four const& b) {
    UnsignedLanes const off = (a.x ^ b.x) | (a.y ^ b.y) | (a.z ^ b.z);
    return reinterpret_cast<UnsignedLanes>((off & ~7u) != 0);
  }
  /// The odd positions before the even ones; `last` are those of the eight before.
  static Four before(Four const& last, Four const& odd) {
    auto const shift = [](UnsignedLanes l, UnsignedLanes v) {
      auto const ends = __builtin_shufflevector(l, v, 3, 3, 4, 4);
      return __builtin_shufflevector(ends, v, 0, 2, 5, 6);
    };
    return {shift(last.x, odd.x), shift(last.y, odd.y), shift(last.z, odd.z)};
  }

  void findEight(int3 const* positions, std::size_t n, Four& last, BulkPlace* places) {
    auto const [even, odd] = load(positions);
    Shorts const changed = mix(differ(before(last, odd), even), differ(even, odd));
    last = odd;
    // The low bits of eight bytes, side by side.
    std::uint64_t const first = (bytesOf(changed & 1) * 0x0102040810204080u) >> 56;
    m_first[n / 64] |= first << n % 64;

    Shorts const x = mix(even.x, odd.x), y = mix(even.y, odd.y), z = mix(even.z, odd.z);
    Shorts const sx = x & 4, sy = y & 4, sz = z & 4;
    Shorts const place = (x & 3) | (y & 3) << 2 | (z & 3) << 4 | sx << 6 | sy << 7 | sz << 8;
    std::memcpy(places, &place, sizeof(place));
    // Bit n of eight that stand for slots, where bits 0, 1 and 2 of n are those of the axes.
    auto const among = [](Shorts s, std::uint16_t unset) { return reinterpret_cast<Shorts>(s == 4) ^ unset; };
    std::uint64_t const slots = bytesOf(among(sx, 0x55) & among(sy, 0x33) & among(sz, 0x0f) & 0xff);
    std::memcpy(m_slots.data() + n, &slots, sizeof(slots));
  }

  std::array<std::uint64_t, kMost / 64> m_first{}; ///< a bit for each position that another block begins at
  std::array<std::uint32_t, kMost + kAtOnce + 1> m_starts{};
  std::array<std::uint8_t, kMost + kAtOnce> m_slots{}; ///< of each position, 1 << slot
};

} // namespace VLN::TileTree3D::Internal
