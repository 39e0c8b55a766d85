// The leaves of a file's tree, read by rows and by words of their masks.
//
// A leaf holds 8 x 8 x 8 voxels, k fastest: voxel (i, j, k) is number 64 i + 8 j + k. Its mask has a word for
// each i, with a byte for each j and a bit of that for each k. "Blocks" are its eight cubes of 4 x 4 x 4.
#pragma once

#include "Interop/VdbGridNodesImpl.h"
#include "Interop/VdbImport.h"

#include <algorithm>
#include <bit>
#include <limits>

namespace VLN::Interop {

inline constexpr int kLeafWidth = 8, kBlockWidth = 4;

inline void growBy(IndexBox& box, Coord const& corner, int width) {
  box.grow(toInt3(corner));
  box.grow(toInt3(corner.offsetBy(width)));
}

/// The voxels of a leaf as an array. Those of a bool leaf, which are bits, are copied for it.
template <class LeafT> class LeafValues {
public:
  using Value = typename LeafT::ValueType;

  explicit LeafValues(LeafT const& leaf) {
    if constexpr (std::is_same_v<Value, bool>) {
      for (openvdb::Index n = 0; n < LeafT::SIZE; ++n) m_copy[n] = leaf.getValue(n);
      m_values = m_copy;
    } else {
      m_values = leaf.buffer().data();
    }
  }
  LeafValues(LeafValues const&) = delete;
  LeafValues& operator=(LeafValues const&) = delete;

  Value const* data() const { return m_values; }
  Value const& operator[](int n) const { return m_values[n]; }

private:
  struct Nothing {};
  Value const* m_values;
  [[no_unique_address]] std::conditional_t<std::is_same_v<Value, bool>, bool[512], Nothing> m_copy;
};

/// Whether the four voxels from `row` on hold a value, bit for bit.
template <class V> bool rowHolds(V const* row, V const& value) {
  if constexpr (sizeof(V) == 4) {
    std::uint32_t bits;
    std::memcpy(&bits, &value, sizeof bits);
    std::uint64_t const twice = bits | std::uint64_t(bits) << 32;
    std::uint64_t pairs[2];
    std::memcpy(pairs, row, sizeof pairs);
    return ((pairs[0] ^ twice) | (pairs[1] ^ twice)) == 0;
  } else {
    return sameBits(row[0], value) && sameBits(row[1], value) && sameBits(row[2], value) &&
           sameBits(row[3], value);
  }
}

/// Bits of 64 values that pass a test.
template <class V, class Test> std::uint64_t wordOf(V const* values, Test const& test) {
  // A byte for each, and from every eight of them the low bits side by side: the compiler does the first in
  // wide lanes.
  std::uint8_t passed[64];
  for (int n = 0; n < 64; ++n) passed[n] = test(values[n]);
  std::uint64_t word = 0;
  for (int n = 0; n < 8; ++n) {
    std::uint64_t bytes;
    std::memcpy(&bytes, passed + 8 * n, sizeof bytes);
    word |= (bytes * 0x0102040810204080ull >> 56) << 8 * n;
  }
  return word;
}

/// The voxels that a rule takes for active ones, among 64.
template <class V> std::uint64_t wordByRule(VdbActiveRule rule, V const* values, V const& background) {
  if constexpr (std::is_same_v<V, float>) {
    std::uint32_t bits;
    std::memcpy(&bits, &background, sizeof bits);
    float const width = std::abs(background);
    if (rule == VdbActiveRule::kInsideBand)
      return wordOf(values, [width](float v) { return std::abs(v) < width; });
    return wordOf(values, [bits](float v) { return std::bit_cast<std::uint32_t>(v) != bits; });
  } else {
    return wordOf(values, [&](V const& v) { return followsRule<V>(rule, v, background); });
  }
}

template <class LeafT> std::uint64_t maskWord(LeafT const& leaf, int i) {
  return leaf.getValueMask().template getWord<std::uint64_t>(static_cast<openvdb::Index>(i));
}

/// A bit for each block with an active voxel: block (x, y, z) is number 4 x + 2 y + z, so that numbers rise
/// along the Z-shaped curve.
template <class LeafT> unsigned activeBlocks(LeafT const& leaf) {
  unsigned blocks = 0;
  for (int x = 0; x < 2; ++x) {
    std::uint64_t word = 0;
    for (int i = 0; i < kBlockWidth; ++i) word |= maskWord(leaf, kBlockWidth * x + i);
    for (int n = 0; n < 4; ++n) {
      std::uint64_t const block = std::uint64_t(0x0f0f0f0f) << (32 * (n >> 1) + 4 * (n & 1));
      blocks |= unsigned((word & block) != 0) << (4 * x + n);
    }
  }
  return blocks;
}

/// Box of the active voxels in the leaf, the far corner beyond the last; empty without any.
template <class LeafT> IndexBox activeBox(LeafT const& leaf) {
  unsigned rows = 0;
  std::uint64_t all = 0;
  for (int i = 0; i < kLeafWidth; ++i) {
    std::uint64_t const word = maskWord(leaf, i);
    rows |= unsigned(word != 0) << i;
    all |= word;
  }
  IndexBox box;
  if (all == 0) return box;
  unsigned columns = 0, last = 0;
  for (int j = 0; j < kLeafWidth; ++j) {
    auto const byte = static_cast<unsigned>(all >> 8 * j & 0xFF);
    columns |= unsigned(byte != 0) << j;
    last |= byte;
  }
  Coord const& o = leaf.origin();
  auto const low = [](unsigned set) { return std::countr_zero(set); };
  auto const high = [](unsigned set) { return static_cast<int>(std::bit_width(set)); };
  box.min = {o.x() + low(rows), o.y() + low(columns), o.z() + low(last)};
  box.max = {o.x() + high(rows), o.y() + high(columns), o.z() + high(last)};
  return box;
}

/// Smallest and largest of the active values that are numbers; of the lengths of vectors.
struct ValueRange {
  double minimum = std::numeric_limits<double>::infinity();
  double maximum = -std::numeric_limits<double>::infinity();

  void grow(double v) {
    if (v < minimum) minimum = v;
    if (v > maximum) maximum = v;
  }
  void join(ValueRange const& b) {
    if (b.minimum < minimum) minimum = b.minimum;
    if (b.maximum > maximum) maximum = b.maximum;
  }
  bool empty() const { return minimum > maximum; }
};

template <class LeafT> ValueRange activeRange(LeafT const& leaf, LeafValues<LeafT> const& values) {
  using Value = typename LeafT::ValueType;
  ValueRange range;
  if constexpr (std::is_same_v<Value, float>) {
    float low = std::numeric_limits<float>::infinity(), high = -low;
    for (int i = 0; i < kLeafWidth; ++i) {
      float const* const slice = values.data() + 64 * i;
      for (std::uint64_t word = maskWord(leaf, i); word != 0; word &= word - 1) {
        float const v = slice[std::countr_zero(word)];
        low = v < low ? v : low;
        high = v > high ? v : high;
      }
    }
    range.minimum = low, range.maximum = high;
  } else {
    for (int i = 0; i < kLeafWidth; ++i)
      for (std::uint64_t word = maskWord(leaf, i); word != 0; word &= word - 1)
        range.grow(magnitude(values[64 * i + std::countr_zero(word)]));
  }
  return range;
}

/// Copies a block, as the samples of a tile: i fastest. `block` is its first voxel.
template <class V, class T> void copyBlock(V const* block, T* samples) {
  if constexpr (std::is_same_v<V, T> && sizeof(V) == 4) {
    // Four rows of k become four rows of i.
    using Row = std::uint32_t __attribute__((vector_size(16)));
    for (int j = 0; j < kBlockWidth; ++j) {
      Row r[4];
      for (int i = 0; i < kBlockWidth; ++i) std::memcpy(&r[i], block + 64 * i + 8 * j, sizeof(Row));
      Row const a = __builtin_shufflevector(r[0], r[1], 0, 4, 1, 5), // k 0, 1 of i 0, 1
          b = __builtin_shufflevector(r[2], r[3], 0, 4, 1, 5),       // of i 2, 3
          c = __builtin_shufflevector(r[0], r[1], 2, 6, 3, 7),       // k 2, 3
          d = __builtin_shufflevector(r[2], r[3], 2, 6, 3, 7);
      Row const out[4] = {
          __builtin_shufflevector(a, b, 0, 1, 4, 5), __builtin_shufflevector(a, b, 2, 3, 6, 7),
          __builtin_shufflevector(c, d, 0, 1, 4, 5), __builtin_shufflevector(c, d, 2, 3, 6, 7)};
      for (int k = 0; k < kBlockWidth; ++k) std::memcpy(samples + 16 * k + 4 * j, &out[k], sizeof(Row));
    }
  } else {
    for (int k = 0; k < kBlockWidth; ++k)
      for (int j = 0; j < kBlockWidth; ++j)
        for (int i = 0; i < kBlockWidth; ++i) *samples++ = toElement(block[64 * i + 8 * j + k]);
  }
}

/// Writes the states of a block's voxels, as the samples of a tile: i fastest. The block begins with voxel
/// `first`.
template <class LeafT> void writeBlockStates(LeafT const& leaf, int first, unsigned char* states) {
  for (int i = 0; i < kBlockWidth; ++i) {
    std::uint64_t const word = maskWord(leaf, first / 64 + i) >> first % 64;
    for (int j = 0; j < kBlockWidth; ++j)
      for (int k = 0; k < kBlockWidth; ++k)
        states[i + 4 * j + 16 * k] =
            static_cast<unsigned char>(kVdbStateLeaf | (word >> (8 * j + k) & 1) * kVdbStateActive);
  }
}

/// What lies at the place of a leaf: one, or a value of the tile there.
template <class TreeT> struct LeafPlace {
  using Leaf = typename TreeT::LeafNodeType;
  using Value = typename TreeT::ValueType;

  Leaf const* leaf = nullptr;
  Value const* values = nullptr; ///< of the leaf, unless they are bits
  Value value{};                 ///< without a leaf
  bool isNarrow = false;         ///< whether the tile is known to be as wide as a leaf

  using Lower = typename TreeT::RootNodeType::ChildNodeType::ChildNodeType;

  template <class AccessorT> void lookUp(AccessorT& grid, Coord const& corner) {
    take(grid.probeConstLeaf(corner));
    if (!leaf) value = grid.getValue(corner);
  }
  /// The same where the node above is known.
  void lookUp(Lower const& lower, Coord const& corner) {
    auto const slot = Lower::coordToOffset(corner);
    take(lower.isChildMaskOn(slot) ? lower.getTable()[slot].getChild() : nullptr);
    if (!leaf) value = lower.getTable()[slot].getValue(), isNarrow = true;
  }
  void take(Leaf const* found) {
    leaf = found;
    if constexpr (!std::is_same_v<Value, bool>)
      if (leaf) values = leaf->buffer().data();
  }
  Value valueAt(int n) const {
    if (!leaf) return value;
    if constexpr (std::is_same_v<Value, bool>)
      return leaf->getValue(static_cast<openvdb::Index>(n));
    else
      return values[n];
  }
  /// Whether I x J x K voxels, each 1 or 4, from voxel number n on hold a value.
  template <int I, int J, int K> bool holds(int n, Value const& wanted) const {
    if (!leaf) return sameBits(value, wanted);
    for (int i = 0; i < I; ++i)
      for (int j = 0; j < J; ++j) {
        int const row = n + 64 * i + 8 * j;
        if constexpr (std::is_same_v<Value, bool>) {
          for (int k = 0; k < K; ++k)
            if (valueAt(row + k) != wanted) return false;
        } else if (K == 1 ? !sameBits(values[row], wanted) : !rowHolds(values + row, wanted)) {
          return false;
        }
      }
    return true;
  }
};

/// The places round the place of one leaf, each looked up when it is first asked for.
template <class GridT> class LeafPlaces {
public:
  using TreeT = typename GridT::TreeType;
  using Value = typename GridT::ValueType;
  using Accessor = typename GridT::ConstAccessor;

  LeafPlaces(Accessor& grid, Coord const& origin)
      : m_grid(grid)
      , m_origin(origin)
      , m_lower(grid.template probeConstNode<Lower>(origin)) {}

  /// The place x, y, z leaves away, each -1, 0 or 1.
  LeafPlace<TreeT> const& at(int x, int y, int z) {
    auto const n = static_cast<std::size_t>(9 * (x + 1) + 3 * (y + 1) + z + 1);
    LeafPlace<TreeT>& place = m_lookupTable[n];
    if (!m_known[n]) {
      m_known[n] = true;
      Coord const corner = m_origin.offsetBy(kLeafWidth * x, kLeafWidth * y, kLeafWidth * z);
      auto const sameNode = [&](int a) {
        return (static_cast<unsigned>(corner[a]) ^ static_cast<unsigned>(m_origin[a])) <
               unsigned(kNodeWidths[1]);
      };
      if (m_lower && sameNode(0) && sameNode(1) && sameNode(2))
        place.lookUp(*m_lower, corner);
      else
        place.lookUp(m_grid, corner);
    }
    return place;
  }

  /// Whether all voxels of a block, and the layer of voxels beyond its high sides, hold one value: then every
  /// blend that begins in the block gives that value.
  /// @param block In blocks from the leaf's origin, each -1, 0 or 1.
  bool isUniform(int x, int y, int z) {
    Value const first = valueAt(x, y, z);
    // The few voxels beyond edges first: where values change, they mostly tell.
    return holds<1, 1, 1>(x + 1, y + 1, z + 1, first) && holds<1, 1, 4>(x + 1, y + 1, z, first) &&
           holds<1, 4, 1>(x + 1, y, z + 1, first) && holds<4, 1, 1>(x, y + 1, z + 1, first) &&
           holds<1, 4, 4>(x + 1, y, z, first) && holds<4, 1, 4>(x, y + 1, z, first) &&
           holds<4, 4, 1>(x, y, z + 1, first) && holds<4, 4, 4>(x, y, z, first);
  }
  /// The first voxel of a block.
  Value valueAt(int x, int y, int z) { return at(x >> 1, y >> 1, z >> 1).valueAt(numberIn(x, y, z)); }

private:
  static int numberIn(int x, int y, int z) { return kBlockWidth * (64 * (x & 1) + 8 * (y & 1) + (z & 1)); }
  template <int I, int J, int K> bool holds(int x, int y, int z, Value const& wanted) {
    return at(x >> 1, y >> 1, z >> 1).template holds<I, J, K>(numberIn(x, y, z), wanted);
  }

  using Lower = typename LeafPlace<TreeT>::Lower;

  Accessor& m_grid;
  Coord m_origin;
  Lower const* m_lower; ///< the node that the leaf's place is in, if it is that fine
  LeafPlace<TreeT> m_lookupTable[27];
  bool m_known[27] = {};
};

} // namespace VLN::Interop
