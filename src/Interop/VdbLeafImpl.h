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

/// The corner of the leaf that would hold a voxel.
inline int3 leafPlaceOf(int3 const& c) { return {c.x & -kLeafWidth, c.y & -kLeafWidth, c.z & -kLeafWidth}; }

inline void growBy(IndexBox& box, Coord const& corner, int width) {
  box.grow(toInt3(corner));
  box.grow(toInt3(corner.offsetBy(width)));
}

/// The voxels of a leaf as an array. Those of a bool leaf, which are bits, are copied for it.
template <class LeafT> class LeafValues {
public:
  using Value = typename LeafT::ValueType;

  /// @param values Where they are, unless they are bits.
  LeafValues(LeafT const& leaf, Value const* values) {
    if constexpr (std::is_same_v<Value, bool>) {
      for (openvdb::Index n = 0; n < LeafT::SIZE; ++n) m_copy[n] = leaf.getValue(n);
      m_values = m_copy;
    } else {
      m_values = values;
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

/// The same of the active voxels of a leaf, four at a time.
/// @edges Does not tell which zero came first.
template <class LeafT> ValueRange rangeByFours(LeafT const& leaf, float const* values) {
  using Lanes = float __attribute__((vector_size(16)));
  using Bits = std::int32_t __attribute__((vector_size(16)));
  constexpr float kFar = std::numeric_limits<float>::infinity();
  constexpr Bits kBit = {1, 2, 4, 8};
  Lanes low = {kFar, kFar, kFar, kFar}, high = -low;
  for (int i = 0; i < kLeafWidth; ++i) {
    std::uint64_t word = maskWord(leaf, i);
    for (float const* at = values + 64 * i; word != 0; word >>= 4, at += 4) {
      Bits bits;
      std::memcpy(&bits, at, sizeof bits);
      // What is not active becomes no number, which is neither smaller nor larger.
      auto const four = static_cast<std::int32_t>(word & 15);
      bits |= (Bits{four, four, four, four} & kBit) == 0;
      Lanes v;
      std::memcpy(&v, &bits, sizeof v);
      low = v < low ? v : low;
      high = v > high ? v : high;
    }
  }
  ValueRange range;
  for (int lane = 0; lane < 4; ++lane) range.join({low[lane], high[lane]});
  return range;
}

template <class LeafT> ValueRange activeRange(LeafT const& leaf, LeafValues<LeafT> const& values) {
  using Value = typename LeafT::ValueType;
  ValueRange range;
  if constexpr (std::is_same_v<Value, float>) {
    range = rangeByFours(leaf, values.data());
    if (range.minimum != 0 && range.maximum != 0) return range;
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
  std::uint32_t rows[kBlockWidth] = {}; // for each j, a byte for each i, and a bit of that for each k
  for (int i = 0; i < kBlockWidth; ++i) {
    std::uint64_t const word = maskWord(leaf, first / 64 + i) >> first % 64;
    for (int j = 0; j < kBlockWidth; ++j) rows[j] |= std::uint32_t(word >> 8 * j & 0xF) << 8 * i;
  }
  constexpr std::uint32_t kEach = 0x01010101;
  for (int k = 0; k < kBlockWidth; ++k)
    for (int j = 0; j < kBlockWidth; ++j) {
      std::uint32_t const four = kVdbStateLeaf * kEach | (rows[j] >> k & kEach) * kVdbStateActive;
      std::memcpy(states + 4 * j + 16 * k, &four, sizeof four);
    }
}

} // namespace VLN::Interop
