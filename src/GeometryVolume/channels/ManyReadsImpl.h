// ManyReads: elements at many positions, found side by side.
//
//   positions --> entries --> blocks --> elements      each step for all of them, and fetched ahead
//
// One after another, reads wait for each of these steps, and the processor sees few reads ahead.
#pragma once

#include "GeometryVolume/channels/PartPlacesImpl.h"
#include "GeometryVolume/channels/detail/ElementRows.h"

#include <algorithm>
#include <array>
#include <bit>
#include <cstddef>
#include <cstdint>
#include <cstring>
#include <span>

namespace VLN::TileTree3D::Internal {

/// @tparam Block Has tile(slot): null, or a tile's elements.
/// @tparam Size Of the bytes of an element: a constant, or the number itself.
/// @threads One for each thread.
template <class Block, class Size> class ManyReads {
public:
  using int3 = Velorn::Math::int3;

  ManyReads(ElementRows const& rows, Size size)
      : m_size(size)
      , m_tileBytes(rows.width * rows.width * rows.width * size) {
    for (std::size_t n = 0; n < m_offsets.size(); ++n)
      m_offsets[n] = static_cast<std::uint32_t>(rows.offset(n % 4, n / 4 % 4, n / 16));
  }

  /// @param fetchEntry Called with positions; fetches what `findBlock` looks at.
  /// @param findBlock Gives the block that holds a position.
  /// @param values Gets an element for each position.
  /// @param missing Called with the numbers of positions without a tile, whose values it is to give.
  template <class FetchEntry, class FindBlock, class Missing>
  void read(std::span<int3 const> positions, FetchEntry const& fetchEntry, FindBlock const& findBlock,
            void* values, Missing const& missing) {
    // While a part is copied, the next one is on its way.
    std::size_t const count = (positions.size() + kMost - 1) / kMost;
    for (std::size_t n = 0; n <= count; ++n) {
      if (n < count)
        fetch(positions.subspan(n * kMost, std::min(kMost, positions.size() - n * kMost)), fetchEntry,
              findBlock, m_parts[n % 2]);
      if (n > 0)
        copy(m_parts[(n - 1) % 2], static_cast<char*>(values) + (n - 1) * kMost * m_size,
             [&](std::size_t at) { missing((n - 1) * kMost + at); });
    }
  }

private:
  /// What is fetched ahead for so many stays in the nearest cache.
  static constexpr std::size_t kMost = 256;
  /// Runs of so many positions on average read most of their tiles.
  static constexpr std::size_t kLong = 8;

  struct Part {
    std::size_t count = 0, runs = 0; ///< of positions, and how often another block begins
    bool isFarApart = false;
    PartPlaces where;
    std::array<BulkPlace, kMost> places;
    std::array<Block const*, kMost> blocks;  ///< of runs
    std::array<char const*, kMost> elements; ///< of positions far apart
  };

  template <class FetchEntry, class FindBlock>
  void fetch(std::span<int3 const> positions, FetchEntry const& fetchEntry, FindBlock const& findBlock,
             Part& part) const {
    part.count = positions.size();
    part.where.find(positions.data(), part.count, part.places.data(), {0, 0});
    std::uint32_t const* const starts = part.where.runStarts();
    for (part.runs = 0; starts[part.runs] < part.count; ++part.runs) fetchEntry(positions[starts[part.runs]]);
    for (std::size_t r = 0; r < part.runs; ++r) {
      part.blocks[r] = findBlock(positions[starts[r]]);
      __builtin_prefetch(part.blocks[r]);
    }
    part.isFarApart = part.count < kLong * part.runs;
    if (part.isFarApart)
      fetchElements(part);
    else
      fetchTiles(part);
  }
  void fetchElements(Part& part) const {
    std::uint32_t const* const starts = part.where.runStarts();
    for (std::size_t r = 0; r < part.runs; ++r) {
      Block const& block = *part.blocks[r];
      for (std::uint32_t n = starts[r]; n < starts[r + 1]; ++n) {
        part.elements[n] = element(block, part.places[n]);
        __builtin_prefetch(part.elements[n]);
      }
    }
  }
  void fetchTiles(Part const& part) const {
    std::uint32_t const* const starts = part.where.runStarts();
    for (std::size_t r = 0; r < part.runs; ++r) {
      std::uint32_t slots = part.where.slotsOf(starts[r], starts[r + 1] - starts[r]).bits();
      for (; slots; slots &= slots - 1) {
        auto const* const tile = static_cast<char const*>(part.blocks[r]->tile(std::countr_zero(slots)));
        for (std::size_t byte = 0; byte < m_tileBytes; byte += 64) __builtin_prefetch(tile + byte);
      }
    }
  }
  template <class Missing> void copy(Part const& part, char* values, Missing const& missing) const {
    auto const copyOne = [&, size = m_size](std::size_t n, char const* from) {
      if (from) [[likely]]
        std::memcpy(values + n * size, from, size);
      else
        missing(n);
    };
    if (part.isFarApart) {
      for (std::size_t n = 0; n < part.count; ++n) copyOne(n, part.elements[n]);
      return;
    }
    std::uint32_t const* const starts = part.where.runStarts();
    for (std::size_t r = 0; r < part.runs; ++r) {
      Block const& block = *part.blocks[r];
      std::uint32_t const end = starts[r + 1];
      for (std::uint32_t n = starts[r]; n < end; ++n) copyOne(n, element(block, part.places[n]));
    }
  }
  [[gnu::always_inline]] char const* element(Block const& block, BulkPlace place) const {
    auto const* const tile = static_cast<char const*>(block.tile(place.slot));
    return tile ? tile + m_offsets[place.element] : nullptr;
  }

  [[no_unique_address]] Size m_size;
  std::size_t m_tileBytes;
  std::array<std::uint32_t, 64> m_offsets; ///< in bytes, of the samples of a tile
  std::array<Part, 2> m_parts;
};

} // namespace VLN::TileTree3D::Internal
