// The values and the nodes of a file's tree, as import and export see them.
#pragma once

#include "Interop/VdbRecord.h"
#include "Interop/VdbTreeImpl.h"

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
template <class V> bool sameBits(V const& a, V const& b) { return std::memcmp(&a, &b, sizeof(V)) == 0; }

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

/// Calls `f(corner, width, value, active)` for each tile of the file's tree, active or not.
template <class TreeT, class F> void forEachTile(TreeT const& tree, F const& f) {
  using Upper = typename TreeT::RootNodeType::ChildNodeType;
  using Lower = typename Upper::ChildNodeType;
  for (auto it = tree.root().cbeginValueAll(); it; ++it)
    f(it.getCoord(), kNodeWidths[2], *it, it.isValueOn());
  std::vector<Upper const*> uppers;
  tree.getNodes(uppers);
  for (Upper const* node : uppers)
    for (auto it = node->cbeginValueAll(); it; ++it) f(it.getCoord(), kNodeWidths[1], *it, it.isValueOn());
  std::vector<Lower const*> lowers;
  tree.getNodes(lowers);
  for (Lower const* node : lowers)
    for (auto it = node->cbeginValueAll(); it; ++it) f(it.getCoord(), kNodeWidths[0], *it, it.isValueOn());
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
