// A slow, plain reader of the flat buffer, written from the description of the format alone. It shares no
// line with the library's reader and looks at nothing but the bytes.
//
// The constructor walks the whole buffer and throws std::runtime_error with a sentence at the first thing
// that is not as described.
#pragma once

#include "Velorn/Math.h"

#include <array>
#include <cstdint>
#include <cstring>
#include <map>
#include <stdexcept>
#include <string>
#include <vector>

namespace Support {

using Velorn::Math::int3;

class FlatModel {
public:
  static constexpr std::uint32_t kNone = 0xFFFFFFFFu;

  struct Tile {
    int3 corner{0, 0, 0};
    int depth = -1;
    std::uint32_t parent = kNone;
    /// Levels of an incomplete block: its children lie that many depths further down.
    int levels = 0;
    /// 2^(levels + 1) along an axis, x fastest.
    std::vector<std::uint32_t> children;
    bool isLeaf() const { return children.empty(); }
  };

  struct Grid {
    std::uint64_t start = 0, size = 0, checksum = 0;
    std::uint32_t index = 0, count = 0, gridClass = 0, type = 0;
    std::string name;
    double voxelSize = 0;
    std::array<double, 6> worldBox{};
    std::array<std::int32_t, 6> box{};
    /// One entry more than tiles.
    std::vector<std::uint64_t> table;
    std::vector<std::uint8_t> defaultValue;

    std::uint64_t offset(std::size_t n) const { return table[n] & 0xFFFFFFFFFFFFull; }
    int width(std::size_t n) const { return static_cast<int>(table[n] >> 48 & 0xFF); }
    int levels(std::size_t n) const { return static_cast<int>(table[n] >> 56); }
    std::uint64_t end() const { return table.back(); }
  };

  FlatModel(std::uint8_t const* bytes, std::uint64_t length);

  std::uint64_t bufferSize = 0, containerSize = 0;
  std::array<std::uint32_t, 30> accum{};
  int rootDepth = 0;
  int3 llc{0, 0, 0};
  std::uint64_t sentinel = 0;
  std::vector<Tile> tiles;
  std::vector<Grid> grids;

  static std::int64_t width(int depth) { return std::int64_t(1) << (30 - depth); }
  std::uint32_t countAt(int depth) const {
    return accum[static_cast<std::size_t>(depth) + 1] - accum[static_cast<std::size_t>(depth)];
  }
  /// The deepest tile at or above `depth` that holds the point, by root slot and child tables alone.
  std::uint32_t find(int3 const& p, int depth) const;
  Grid const& grid(std::string const& name) const;

  /// Bytes of the element type that stands in a grid of this type.
  static std::uint64_t elementBytes(std::uint32_t type);
  static bool isQuantised(std::uint32_t type) { return type >= 13 && type <= 16; }

  /// The stored block of a tile: `w` samples along an axis. For a tile of a texture, its brick.
  template <class T> std::vector<T> block(Grid const& g, std::size_t n) const {
    int const w = g.width(n);
    std::vector<T> result(static_cast<std::size_t>(w) * w * w);
    std::memcpy(static_cast<void*>(result.data()), at(g.start + 736 + g.offset(n), result.size() * sizeof(T)),
                result.size() * sizeof(T));
    return result;
  }
  /// The brick at (x, y, z) of a texture of `dim` samples along an axis.
  template <class T> std::vector<T> brick(Grid const& g, int dim, int x, int y, int z) const {
    std::vector<T> result;
    for (int k = 0; k < 5; ++k)
      for (int j = 0; j < 5; ++j)
        for (int i = 0; i < 5; ++i) {
          std::uint64_t const flat =
              std::uint64_t(5 * x + i) +
              std::uint64_t(dim) * (std::uint64_t(5 * y + j) + std::uint64_t(dim) * std::uint64_t(5 * z + k));
          T value;
          std::memcpy(static_cast<void*>(&value),
                      at(g.start + 736 + g.table.size() * 8 + flat * sizeof(T), sizeof(T)), sizeof(T));
          result.push_back(value);
        }
    return result;
  }

  struct Quantised {
    float minimum = 0, quantum = 0;
    int bits = 0;
    std::vector<std::uint32_t> codes;
    float value(std::size_t k) const {
      return static_cast<float>(static_cast<double>(minimum) +
                                static_cast<double>(codes[k]) * static_cast<double>(quantum));
    }
  };
  Quantised quantised(Grid const& g, std::size_t n) const;

  /// The value that the description gives for a checksum mode: 0 none, 1 partial, 2 full.
  std::uint64_t checksum(Grid const& g, int mode) const;
  static std::uint32_t crc32(std::uint8_t const* bytes, std::uint64_t count);

  std::uint8_t const* at(std::uint64_t offset, std::uint64_t count) const {
    if (count > m_length || offset > m_length - count)
      throw std::runtime_error("read beyond the buffer at " + std::to_string(offset));
    return m_bytes + offset;
  }
  template <class T> T get(std::uint64_t offset) const {
    T value;
    std::memcpy(static_cast<void*>(&value), at(offset, sizeof(T)), sizeof(T));
    return value;
  }

private:
  void readContainer();
  void walk(std::uint32_t number, int3 const& corner, int depth, std::uint32_t parent);
  void readGrid(std::uint64_t start, std::uint32_t index);
  void readTable(Grid& g) const;
  static void check(bool ok, std::string const& what) {
    if (!ok) throw std::runtime_error(what);
  }

  std::uint8_t const* m_bytes;
  std::uint64_t m_length;
  std::map<std::uint32_t, std::uint64_t> m_childTables;
};

} // namespace Support
