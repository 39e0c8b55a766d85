// The values and the nodes of a file's tree, as import and export see them.
#pragma once

#include "GeometryVolume/tiletree/Morton.h"
#include "Interop/VdbRecord.h"
#include "Interop/VdbTreeImpl.h"

#include <algorithm>
#include <bit>
#include <cmath>
#include <cstring>

namespace VLN::Interop {

using openvdb::Coord;
using TileTree3D::TreeIndex;
using Velorn::Math::int3;

inline int3 toInt3(Coord const& c) { return {c.x(), c.y(), c.z()}; }
inline Coord toCoord(int3 const& c) { return {c.x, c.y, c.z}; }

// --- Values ---

template <class T> struct ElementOf { using type = T; };
template <> struct ElementOf<bool> { using type = unsigned char; };
template <class S> struct ElementOf<openvdb::math::Vec3<S>> { using type = Velorn::Math::Vec3<S>; };

template <class T> T toElement(T v) { return v; }
inline unsigned char toElement(bool v) { return v ? 1 : 0; }
template <class S> Velorn::Math::Vec3<S> toElement(openvdb::math::Vec3<S> const& v) {
  return {v[0], v[1], v[2]};
}

template <class V, class T> V fromElement(T const& v) {
  if constexpr (std::is_same_v<V, bool>)
    return v != 0;
  else if constexpr (std::is_same_v<V, T>)
    return v;
  else
    return V(v.x, v.y, v.z);
}

/// Equal bit for bit, so that NaN and the sign of zero count.
template <class V> bool sameBits(V const& a, V const& b) {
  return std::memcmp(&a, &b, sizeof(V)) == 0; // NOLINT(bugprone-suspicious-memory-comparison)
}

/// Value, or length of a vector.
template <class T> double magnitude(T const& v) {
  if constexpr (std::is_arithmetic_v<T>)
    return static_cast<double>(v);
  else
    return std::sqrt(double(v[0]) * double(v[0]) + double(v[1]) * double(v[1]) + double(v[2]) * double(v[2]));
}

template <class V> bool followsRule(VdbActiveRule rule, V const& value, V const& background) {
  if (rule == VdbActiveRule::kNotBackground) return !sameBits(value, background);
  if constexpr (std::is_floating_point_v<V>)
    return std::abs(value) < std::abs(background);
  else
    return false;
}

// --- Nodes ---

/// The axis that leads along the Z-shaped curve, before y: x in files, whose leaves have z fastest, and z
/// among the tiles of a tree, whose samples have x fastest.
enum class LeadingAxis { kX, kZ };

template <LeadingAxis kLeads> bool comesBefore(int3 const& a, int3 const& b) {
  if constexpr (kLeads == LeadingAxis::kX)
    return TileTree3D::mortonLess(a, b);
  else
    return TileTree3D::mortonLess({a.z, a.y, a.x}, {b.z, b.y, b.x});
}

/// The slots of a node along the Z-shaped curve.
template <int Log2Dim, LeadingAxis kLeads> class SlotOrder {
public:
  static constexpr int kSlots = 1 << 3 * Log2Dim;

  SlotOrder() {
    for (unsigned slot = 0; slot < kSlots; ++slot) {
      unsigned rank = 0;
      for (int bit = 0; bit < Log2Dim; ++bit)
        for (int a = 0; a < 3; ++a) // z, y, x
          rank |= (slot >> (Log2Dim * a + bit) & 1) << (3 * bit + (kLeads == LeadingAxis::kX ? a : 2 - a));
      m_rank[slot] = static_cast<std::uint16_t>(rank);
      m_slot[rank] = static_cast<std::uint16_t>(slot);
    }
  }
  static SlotOrder const& table() {
    static SlotOrder const made;
    return made;
  }

  /// Calls `f(slot)` for the slots whose bits `wanted(word)` gives, 64 at a time.
  template <class Wanted, class F> void forEach(Wanted const& wanted, F const& f) const {
    std::uint64_t ranks[kSlots / 64] = {};
    for (unsigned n = 0; n < kSlots / 64; ++n)
      for (std::uint64_t word = wanted(n); word != 0; word &= word - 1) {
        unsigned const rank = m_rank[64 * n + static_cast<unsigned>(std::countr_zero(word))];
        ranks[rank / 64] |= std::uint64_t(1) << rank % 64;
      }
    for (unsigned n = 0; n < kSlots / 64; ++n)
      for (std::uint64_t word = ranks[n]; word != 0; word &= word - 1)
        f(unsigned(m_slot[64 * n + static_cast<unsigned>(std::countr_zero(word))]));
  }

private:
  std::uint16_t m_rank[kSlots], m_slot[kSlots];
};

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

/// The entries of a node's table that hold another value than the background. Those of children are anything.
template <class Entry, class Value> class OtherValues {
public:
  explicit OtherValues(Value const& background)
      : m_background(background) {
    std::memset(m_value, 0, sizeof m_value);
    std::memset(m_mask, 0, sizeof m_mask);
    for (std::size_t at = 0; kInLanes && at < sizeof m_value; at += sizeof(Entry)) {
      std::memcpy(m_value + at, &background, sizeof(Value));
      std::memset(m_mask + at, 0xFF, sizeof(Value));
    }
  }
  /// Of 64 entries.
  std::uint64_t among(Entry const* entries) const {
    if (kInLanes && areBackground(entries)) return 0; // as most are
    return wordOf(entries, [&](Entry const& entry) { return !sameBits(entry.getValue(), m_background); });
  }

private:
  // Values begin where their entries do.
  static constexpr bool kInLanes =
      std::is_trivially_copyable_v<Entry> && (sizeof(Entry) == 8 || sizeof(Entry) == 16);

  bool areBackground(Entry const* entries) const {
    using Lanes = std::uint64_t __attribute__((vector_size(16)));
    Lanes value, mask, any = {};
    std::memcpy(&value, m_value, sizeof value);
    std::memcpy(&mask, m_mask, sizeof mask);
    auto const* const bytes = reinterpret_cast<char const*>(entries);
    for (std::size_t at = 0; at < 64 * sizeof(Entry); at += sizeof(Lanes)) {
      Lanes some;
      std::memcpy(&some, bytes + at, sizeof some);
      any |= (some ^ value) & mask;
    }
    return (any[0] | any[1]) == 0;
  }

  Value m_background;
  unsigned char m_value[16], m_mask[16];
};

/// Goes through a file's tree along the Z-shaped curve: calls `onLeaf(leaf)`, and `onTile(corner, width,
/// value, active)` for each tile that is active or has another value than the background.
template <LeadingAxis kLeads = LeadingAxis::kX, class TreeT, class OnLeaf, class OnTile>
void forEachInOrder(TreeT const& tree, OnLeaf const& onLeaf, OnTile const& onTile) {
  using Upper = typename TreeT::RootNodeType::ChildNodeType;
  using Value = typename TreeT::ValueType;
  Value const background = tree.background();
  auto const inNode = [&]<class Node, class OnChild>(Node const& node, OnChild const& onChild) {
    auto const* const table = node.getTable();
    auto const& children = node.getChildMask();
    auto const& active = node.getValueMask();
    OtherValues<std::remove_cvref_t<decltype(*table)>, Value> const other(background);
    SlotOrder<Node::LOG2DIM, kLeads>::table().forEach(
        [&](unsigned n) {
          auto const wordIn = [n](auto const& mask) { return mask.template getWord<std::uint64_t>(n); };
          return wordIn(children) | wordIn(active) | other.among(table + 64 * n);
        },
        [&](unsigned slot) {
          if (children.isOn(slot)) return onChild(*table[slot].getChild());
          Coord corner;
          Node::offsetToLocalCoord(slot, corner);
          onTile((corner << Node::ChildNodeType::TOTAL) + node.origin(), 1 << Node::ChildNodeType::TOTAL,
                 table[slot].getValue(), active.isOn(slot));
        });
  };
  struct Entry {
    Coord corner;
    Upper const* node;
    Value value;
    bool active;
  };
  std::vector<Entry> entries;
  for (auto it = tree.root().cbeginChildOn(); it; ++it) entries.push_back({it.getCoord(), &*it, {}, false});
  for (auto it = tree.root().cbeginValueAll(); it; ++it)
    if (it.isValueOn() || !sameBits(*it, background))
      entries.push_back({it.getCoord(), nullptr, *it, it.isValueOn()});
  std::sort(entries.begin(), entries.end(), [](Entry const& a, Entry const& b) {
    return comesBefore<kLeads>(toInt3(a.corner), toInt3(b.corner));
  });
  for (Entry const& entry : entries) {
    if (!entry.node)
      onTile(entry.corner, kNodeWidths[2], entry.value, entry.active);
    else
      inNode(*entry.node, [&](auto const& lower) { inNode(lower, onLeaf); });
  }
}

/// Whether every node lies where a search for its position looks: the root's entries come from the file, and
/// so do the corners of leaves of bools and masks.
template <class TreeT> bool placesAgree(TreeT const& tree) {
  using Upper = typename TreeT::RootNodeType::ChildNodeType;
  using Lower = typename Upper::ChildNodeType;
  bool ok = true;
  auto const isEntry = [](Coord const& c) { return (c & -kNodeWidths[2]) == c; };
  for (auto it = tree.root().cbeginChildOn(); it; ++it) ok = ok && isEntry(it.getCoord());
  for (auto it = tree.root().cbeginValueAll(); it; ++it) ok = ok && isEntry(it.getCoord());
  std::vector<Lower const*> parents;
  tree.getNodes(parents);
  for (Lower const* parent : parents)
    for (auto it = parent->cbeginChildOn(); it; ++it) ok = ok && it.getCoord() == it->origin();
  return ok;
}

inline bool fitsTheTree(Coord const& corner, int width) {
  for (int a = 0; a < 3; ++a) {
    // The domain's ends are multiples of every node's width, so a corner inside means that all is.
    if (!VdbTraits::inDomain(corner[a]) || (corner[a] & (width - 1)) != 0) return false;
  }
  return true;
}

inline int3 alignTo(int3 const& c, int depth) {
  return {VdbTraits::align(c.x, depth), VdbTraits::align(c.y, depth), VdbTraits::align(c.z, depth)};
}

} // namespace VLN::Interop
