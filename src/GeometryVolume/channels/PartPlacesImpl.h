// PartPlaces: where positions lie in their blocks, many at once, and where one block ends and the next
// begins.
#pragma once

#include "GeometryVolume/channels/EightPlacesImpl.h"

#include <algorithm>
#include <array>
#include <bit>
#include <cstddef>
#include <cstdint>
#include <cstring>

namespace VLN::TileTree3D::Internal {

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
  static constexpr std::uint32_t kMost = 1024, kAtOnce = 64;

  explicit PartPlaces(FindPlaces findEights = findPlaces())
      : m_findEights(findEights) {}

  /// @param places Gets `count` of them.
  /// @param values What is fetched meanwhile, from the part's own on; empty for nothing.
  void find(Velorn::Math::int3 const* positions, std::size_t count, BulkPlace* places, ArrayAhead values) {
    ArrayAhead const ahead{reinterpret_cast<std::uintptr_t>(positions), sizeof(Velorn::Math::int3)};
    auto* const first = reinterpret_cast<std::uint8_t*>(m_first.data());
    m_first.fill(0);
    std::size_t n = 0;
    for (std::size_t const whole = count & ~std::size_t(7); n < whole;) {
      std::size_t const some = std::min<std::size_t>(kAtOnce, whole - n);
      ahead.fetch(kMost + n, some);
      values.fetch(n, some);
      m_findEights(positions + n, some / 8, positions[n - (n > 0)],
                   {places + n, m_slots.data() + n, first + n / 8});
      n += some;
    }
    if (n < count) {
      Velorn::Math::int3 rest[8] = {};
      BulkPlace placesOfRest[8];
      std::memcpy(rest, positions + n, (count - n) * sizeof(Velorn::Math::int3));
      m_findEights(rest, 1, positions[n - (n > 0)], {placesOfRest, m_slots.data() + n, first + n / 8});
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
    auto const eight = [from = m_slots.data() + first](std::size_t n) {
      std::uint64_t out;
      std::memcpy(&out, from + n, sizeof(out));
      return out;
    };
    // Rows through a block are the rule: no branch for how long they are.
    if (count <= 8) return {eight(0) << (64 - 8 * count)};
    std::uint64_t all = eight(count - 8);
    for (std::size_t n = 0; n + 8 < count; n += 8) all |= eight(n);
    return {all};
  }

private:
  FindPlaces m_findEights;
  std::array<std::uint64_t, kMost / 64> m_first{}; ///< a bit for each position that another block begins at
  std::array<std::uint32_t, kMost + 8 + 1> m_starts{};
  std::array<std::uint8_t, kMost + 8> m_slots{}; ///< of each position, 1 << slot
};

} // namespace VLN::TileTree3D::Internal
