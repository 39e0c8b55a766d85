// What the walk through a .vdb file knows of the format: bytes that are taken one after another, and what a
// node takes of them.
//
//   values of a node   code; inactive values; which of two they are; values: [size] bytes
//   tree               1; background; counts of tiles and nodes; tiles; nodes of 4096 voxels
//   node               mask of nodes in it; mask of active values; values; nodes in it, a leaf's as a mask
//   buffers            of each leaf: mask of active values; values
#pragma once

#include "Interop/VdbTreeImpl.h"

#include <algorithm>
#include <bit>
#include <cstring>
#include <limits>

namespace VLN::Interop {

/// What ends a walk: nothing is said of the file.
struct WalkEnds {};

inline void walkOnlyIf(bool usual) {
  if (!usual) throw WalkEnds();
}

class WalkedBytes {
public:
  WalkedBytes(char const* begin, std::size_t size)
      : m_begin(begin)
      , m_at(begin)
      , m_end(begin + size) {}

  char const* take(std::uint64_t count) {
    walkOnlyIf(count <= static_cast<std::uint64_t>(m_end - m_at));
    char const* const taken = m_at;
    m_at += count;
    return taken;
  }
  template <class T> T number() {
    T value;
    std::memcpy(&value, take(sizeof(T)), sizeof(T));
    return value;
  }
  std::string text() {
    auto const size = number<std::uint32_t>();
    return {take(size), size};
  }
  std::size_t place() const { return static_cast<std::size_t>(m_at - m_begin); }
  char const* data() const { return m_begin; }
  std::size_t size() const { return static_cast<std::size_t>(m_end - m_begin); }

private:
  char const *m_begin, *m_at, *m_end;
};

/// How the values of a grid are written.
struct ValueCoding {
  std::uint32_t compression = 0;
  bool half = false;
};

/// Takes an array of bytes that may be compressed.
inline void walkData(WalkedBytes& bytes, std::uint64_t size, std::uint32_t compression) {
  using namespace openvdb::io;
  if (!(compression & (COMPRESS_BLOSC | COMPRESS_ZIP))) {
    bytes.take(size);
    return;
  }
  auto const written = bytes.number<std::int64_t>();
  if (written <= 0) { // as they are
    walkOnlyIf(written == -static_cast<std::int64_t>(size));
    bytes.take(size);
    return;
  }
  char const* const data = bytes.take(static_cast<std::uint64_t>(written));
  if (!(compression & COMPRESS_BLOSC)) return;
  // Blosc goes by the sizes in its own header.
  WalkedBytes header(data, static_cast<std::size_t>(written));
  header.take(4); // versions, flags, width of a value
  auto const unpacked = header.number<std::uint32_t>();
  header.take(4); // width of a block
  walkOnlyIf(unpacked == size && header.number<std::uint32_t>() == static_cast<std::uint64_t>(written));
}

inline unsigned bitsIn(char const* mask, std::size_t bytes) {
  unsigned count = 0;
  for (std::size_t n = 0; n < bytes; n += 8) {
    std::uint64_t word;
    std::memcpy(&word, mask + n, sizeof word);
    count += static_cast<unsigned>(std::popcount(word));
  }
  return count;
}

/// Where the values of a node lie, and what stands for those that are not there.
struct WrittenValues {
  std::int8_t code = 0;
  char const* inactive = nullptr;  ///< up to two values
  char const* selection = nullptr; ///< null, or a mask of those that are the second of two
  std::size_t place = 0;           ///< of the others
  std::uint32_t count = 0;         ///< of the others: all values, or the active ones
};

/// Takes the values of a node with `slots` of them.
template <class Value>
WrittenValues walkValues(WalkedBytes& bytes, char const* activeMask, std::uint32_t slots,
                         ValueCoding const& coding) {
  using namespace openvdb::io;
  WrittenValues values;
  auto const code = values.code = bytes.number<std::int8_t>();
  walkOnlyIf(code >= NO_MASK_OR_INACTIVE_VALS && code <= NO_MASK_AND_ALL_VALS);
  bool const one = code == NO_MASK_AND_ONE_INACTIVE_VAL || code == MASK_AND_ONE_INACTIVE_VAL;
  bool const two = code == MASK_AND_TWO_INACTIVE_VALS;
  values.inactive = bytes.take((two ? 2 : one ? 1 : 0) * sizeof(Value));
  if (two || code == MASK_AND_NO_INACTIVE_VALS || code == MASK_AND_ONE_INACTIVE_VAL)
    values.selection = bytes.take(slots / 8);
  bool const activeOnly = (coding.compression & COMPRESS_ACTIVE_MASK) && code != NO_MASK_AND_ALL_VALS;
  values.count = activeOnly ? bitsIn(activeMask, slots / 8) : slots;
  values.place = bytes.place();
  using Half = RealToHalf<Value>;
  if (coding.half && Half::isReal) {
    if (values.count > 0) walkData(bytes, values.count * sizeof(typename Half::HalfT), coding.compression);
  } else {
    walkData(bytes, values.count * sizeof(Value), coding.compression);
  }
  return values;
}

/// OpenVDB turns backgrounds round; the least integer has no other side.
template <class Value> bool hasNegative(Value const& background) {
  if constexpr (std::is_integral_v<Value>)
    return background != std::numeric_limits<Value>::min();
  else if constexpr (std::is_same_v<Value, openvdb::Vec3i>)
    return hasNegative(background[0]) && hasNegative(background[1]) && hasNegative(background[2]);
  else
    return true;
}

struct WalkedTree {
  std::uint64_t memory = 0; ///< bytes that the tree takes with the buffers of its leaves
  std::uint64_t leaves = 0;
};

/// Takes the tree without the buffers of its leaves.
template <class TreeT> WalkedTree walkTopology(WalkedBytes& bytes, ValueCoding const& coding) {
  using Value = typename TreeT::ValueType;
  using Leaf = typename TreeT::LeafNodeType;
  using Upper = typename TreeT::RootNodeType::ChildNodeType;
  using Lower = typename Upper::ChildNodeType;
  constexpr std::uint64_t kEntry = 128; // of the root's map
  WalkedTree tree;
  walkOnlyIf(bytes.number<std::int32_t>() == 1 && hasNegative(bytes.number<Value>()));
  auto const tiles = bytes.number<std::uint32_t>(), nodes = bytes.number<std::uint32_t>();
  auto const corner = [&] {
    for (int a = 0; a < 3; ++a) walkOnlyIf(bytes.number<std::int32_t>() % kNodeWidths[2] == 0);
  };
  // @return The number of nodes below.
  auto const node = [&]<class Node>(Node const*) {
    tree.memory += sizeof(Node);
    constexpr std::uint32_t kSlots = Node::NUM_VALUES;
    char const* const below = bytes.take(kSlots / 8);
    char const* const active = bytes.take(kSlots / 8);
    walkValues<Value>(bytes, active, kSlots, coding);
    return bitsIn(below, kSlots / 8);
  };
  for (std::uint32_t n = 0; n < tiles; ++n) {
    corner();
    bytes.take(sizeof(Value));
    walkOnlyIf(bytes.number<std::uint8_t>() <= 1); // whether it is active
    tree.memory += kEntry;
  }
  for (std::uint32_t n = 0; n < nodes; ++n) {
    corner();
    tree.memory += kEntry;
    for (unsigned lower = node(static_cast<Upper const*>(nullptr)); lower > 0; --lower) {
      unsigned const leaves = node(static_cast<Lower const*>(nullptr));
      bytes.take(std::uint64_t(leaves) * (Leaf::SIZE / 8));
      tree.leaves += leaves;
      tree.memory += std::uint64_t(leaves) * (sizeof(Leaf) + Leaf::SIZE * sizeof(Value));
    }
  }
  return tree;
}

/// Takes the buffers of one leaf.
/// @return What follows the mask.
template <class Leaf> WrittenValues walkBuffers(WalkedBytes& bytes, ValueCoding const& coding) {
  char const* const active = bytes.take(Leaf::SIZE / 8);
  return walkValues<typename Leaf::ValueType>(bytes, active, Leaf::SIZE, coding);
}

/// Puts the values of a leaf in their places: those that were written are the active ones, in order.
/// @param written Of values.count.
template <class Value>
void spreadValues(WrittenValues const& values, char const* activeMask, Value const* written,
                  Value const& background, Value* out) {
  using namespace openvdb::io;
  // As the format has it, the second of two is the background.
  Value inactive[2] = {
      values.code == NO_MASK_OR_INACTIVE_VALS ? background : openvdb::math::negative(background), background};
  if (values.code == NO_MASK_AND_ONE_INACTIVE_VAL || values.code == MASK_AND_ONE_INACTIVE_VAL)
    std::memcpy(&inactive[0], values.inactive, sizeof(Value));
  else if (values.code == MASK_AND_TWO_INACTIVE_VALS)
    std::memcpy(inactive, values.inactive, sizeof inactive);
  for (int i = 0; i < 8; ++i, out += 64) {
    std::uint64_t active, second = 0;
    std::memcpy(&active, activeMask + 8 * i, sizeof active);
    if (values.selection) std::memcpy(&second, values.selection + 8 * i, sizeof second);
    if (second == 0 || second == ~std::uint64_t(0))
      std::fill_n(out, 64, inactive[second & 1]);
    else
      for (int n = 0; n < 64; ++n) out[n] = inactive[second >> n & 1];
    // As many were written as the mask has bits. NOLINTNEXTLINE(clang-analyzer-core.uninitialized.Assign)
    for (; active != 0; active &= active - 1) out[std::countr_zero(active)] = *written++;
  }
}

} // namespace VLN::Interop
