// Which narrow tiles lie among nothing but tiles of their value, for 16 of them at a time.
//
// A node has 16 x 16 x 16 slots, z fastest: a row along z is 16 bits of its mask. With the outermost bits of
// the nodes round it, it is 18 bits wide:
//
//   bit 0        of the node before       bits 1 .. 16   its own       bit 17       of the node behind
#pragma once

#include "GeometryVolume/core/Parallel.h"
#include "Interop/VdbLeafPlacesImpl.h"

#include <algorithm>
#include <array>

namespace VLN::Interop {

/// @threads Readers may share one.
template <class TreeT> class TilesRound {
public:
  using Value = typename TreeT::ValueType;
  using Search = PlaceSearch<TreeT>;
  using Lower = typename Search::Lower;
  /// A bit for each slot of a node.
  using Slots = std::array<std::uint64_t, 64>;

  /// @param value Of the tiles.
  TilesRound(TreeT const& tree, Value const& value)
      : m_value(value) {
    m_all.fill(~std::uint64_t(0));
    tree.getNodes(m_nodes);
    std::sort(m_nodes.begin(), m_nodes.end());
    m_held.resize(m_nodes.size());
    parallelFor(0, std::int64_t(m_nodes.size()), [&](std::int64_t begin, std::int64_t end) {
      for (auto n = begin; n < end; ++n) m_held[n] = tilesIn(*m_nodes[n]);
    });
  }

  /// The slots of a node at whose place and at all 26 places round it lies nothing but the value.
  Slots inside(Search& search, Lower const& node) const {
    std::array<Slots const*, 27> round;
    for (int n = 0; n < 27; ++n)
      round[n] = &slotsAt(search, node.origin().offsetBy((n / 9 - 1) * kWidth, (n / 3 % 3 - 1) * kWidth,
                                                         (n % 3 - 1) * kWidth));
    std::uint32_t rows[kRows][kRows]; // without a place beside them on z
    for (int x = 0; x < kRows; ++x)
      for (int y = 0; y < kRows; ++y) {
        std::uint32_t const row = rowAt(round, x - 1, y - 1);
        rows[x][y] = row & row << 1 & row >> 1;
      }
    for (int x = 1; x <= kSlots; ++x) // nor on y
      for (int y = 0; y < kRows; ++y) rows[x - 1][y] &= rows[x][y] & rows[x + 1][y];
    Slots slots{};
    for (int x = 0; x < kSlots; ++x)
      for (int y = 0; y < kSlots; ++y) {
        std::uint64_t const row = rows[x][y] & rows[x][y + 1] & rows[x][y + 2];
        slots[4 * x + y / 4] |= (row >> 1 & 0xFFFF) << 16 * (y % 4);
      }
    return slots;
  }

private:
  static constexpr int kSlots = 16, kRows = kSlots + 2;
  static constexpr int kWidth = kNodeWidths[1];
  static_assert(Lower::DIM == kWidth && Lower::NUM_VALUES == 4096);

  Slots tilesIn(Lower const& node) const {
    auto const* const table = node.getTable();
    OtherValues<std::remove_cvref_t<decltype(*table)>, Value> const other(m_value);
    Slots slots;
    for (unsigned n = 0; n < slots.size(); ++n)
      slots[n] = ~(node.getChildMask().template getWord<std::uint64_t>(n) | other.among(table + 64 * n));
    return slots;
  }
  Slots const& slotsAt(Search& search, Coord const& corner) const {
    if (Lower const* const node = search.lower(corner)) {
      auto const found = std::lower_bound(m_nodes.begin(), m_nodes.end(), node);
      return m_held[found - m_nodes.begin()];
    }
    return sameBits(search.at(corner).value, m_value) ? m_all : m_none;
  }
  static std::uint32_t rowAt(std::array<Slots const*, 27> const& round, int x, int y) {
    auto const node = [](int a) { return a < 0 ? 0 : a < kSlots ? 1 : 2; };
    auto const* const column = round.data() + 9 * node(x) + 3 * node(y);
    int const at = kSlots * (x & (kSlots - 1)) + (y & (kSlots - 1)); // of the row in its node
    auto const row = [&](Slots const& slots) {
      return static_cast<std::uint32_t>(slots[at / 4] >> 16 * (at % 4) & 0xFFFF);
    };
    return row(*column[0]) >> (kSlots - 1) | row(*column[1]) << 1 | (row(*column[2]) & 1) << (kSlots + 1);
  }

  Value m_value;
  std::vector<Lower const*> m_nodes; ///< by address
  std::vector<Slots> m_held;         ///< tiles of the value in them
  Slots m_all, m_none{};
};

} // namespace VLN::Interop
