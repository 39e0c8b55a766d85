// What blends in and round the leaves of a file's tree meet, without their voxels: one look at a leaf leaves
// a digest of it, and from then on digests answer.
//
// A blend that begins in a block meets 5 x 5 x 5 voxels: the block, and layers of the seven blocks at its
// high sides, one voxel thick on the axes on which they lie further on.
#pragma once

#include "Interop/VdbLeafImpl.h"

#include <cstdint>
#include <cstring>
#include <memory>

namespace VLN::Interop {

/// Each block's first voxel, and which of the block's layers hold its value throughout, bit for bit. Blocks
/// and layers are numbered 4 x + 2 y + z; a layer is one voxel thick on the axes whose bits its number has,
/// four on the others. So layer 0 is the whole block, and layer 7 its first voxel.
template <class Value> struct LeafDigest {
  Value first[8];
  std::uint64_t uniform = 0; ///< bit 8 block + layer

  bool holds(int block, int layer, Value const& wanted) const {
    return (uniform >> (8 * block + layer) & 1) != 0 && sameBits(first[block], wanted);
  }
};

/// A bit for each layer of a block that holds its first voxel's value throughout.
template <class Value> unsigned uniformLayers(Value const* block) {
  if constexpr (sizeof(Value) == 4) {
    using Row = std::int32_t __attribute__((vector_size(16))); // of k: all ones where the values are the same
    std::int32_t first;
    std::memcpy(&first, block, sizeof first);
    auto const slice = [&](int i, Row& atJ0) {
      Row all;
      for (int j = 0; j < kBlockWidth; ++j) {
        Row row;
        std::memcpy(&row, block + 64 * i + 8 * j, sizeof row);
        Row const same = row == first;
        all = j == 0 ? same : all & same;
        if (j == 0) atJ0 = same;
      }
      return all;
    };
    Row rows[4]; // thin on no axis of x and y, on y, on x, on both
    rows[0] = rows[2] = slice(0, rows[3]);
    rows[1] = rows[3];
    for (int i = 1; i < kBlockWidth; ++i) {
      Row atJ0;
      rows[0] &= slice(i, atJ0);
      rows[1] &= atJ0;
    }
    unsigned layers = 0;
    for (unsigned n = 0; n < 4; ++n) {
      std::uint64_t halves[2];
      std::memcpy(halves, &rows[n], sizeof halves);
      layers |= unsigned((halves[0] & halves[1]) == ~std::uint64_t(0)) << 2 * n;
      layers |= unsigned(std::uint32_t(halves[0]) == ~std::uint32_t(0)) << (2 * n + 1);
    }
    return layers;
  } else {
    unsigned layers = 0xFF;
    for (int i = 0; i < kBlockWidth; ++i)
      for (int j = 0; j < kBlockWidth; ++j)
        for (int k = 0; k < kBlockWidth && layers != 0x80; ++k) {
          if (sameBits(block[64 * i + 8 * j + k], *block)) continue;
          // Only layers that are thin on an axis leave out what lies further on.
          constexpr unsigned kThin[3] = {0xF0, 0xCC, 0xAA};
          layers &= (i > 0 ? kThin[0] : 0u) | (j > 0 ? kThin[1] : 0u) | (k > 0 ? kThin[2] : 0u);
        }
    return layers;
  }
}

/// @param values Of a leaf.
template <class Value> LeafDigest<Value> digestOf(Value const* values) {
  LeafDigest<Value> digest;
  for (int block = 0; block < 8; ++block) {
    Value const* const begin =
        values + kBlockWidth * (64 * (block >> 2) + 8 * (block >> 1 & 1) + (block & 1));
    digest.first[block] = *begin;
    digest.uniform |= std::uint64_t(uniformLayers(begin)) << 8 * block;
  }
  return digest;
}

/// What lies at the place of a leaf: one, or a value of the tile there.
template <class TreeT> struct LeafPlace {
  using Leaf = typename TreeT::LeafNodeType;
  using Value = typename TreeT::ValueType;

  Leaf const* leaf = nullptr;
  Value value{};       ///< without a leaf
  int level = 3;       ///< of the tile, as OpenVDB counts: 2 where it is as wide as a leaf, -1 for no tile
  bool active = false; ///< of the tile
};

/// Finds places. OpenVDB's accessors would reach for the buffers of leaves, which may have none.
template <class TreeT> class PlaceSearch {
public:
  using Lower = typename TreeT::RootNodeType::ChildNodeType::ChildNodeType;
  using Place = LeafPlace<TreeT>;

  explicit PlaceSearch(TreeT const& tree)
      : m_tree(tree) {}

  /// The node with the places round a position, if it is that fine.
  Lower const* lower(Coord const& c) { return known(c).lower; }
  Place at(Coord const& c) {
    Known const& node = known(c);
    return node.lower ? at(*node.lower, Lower::coordToOffset(c)) : node.wide;
  }
  /// Whether the places round one in a node are in that node as well.
  static bool isInside(Lower const& lower, Coord const& place) {
    Coord const at = place - lower.origin();
    auto const inside = [](int c) { return c >= kLeafWidth && c < kNodeWidths[1] - kLeafWidth; };
    return inside(at.x()) && inside(at.y()) && inside(at.z());
  }
  static Place at(Lower const& lower, openvdb::Index slot) {
    auto const& entry = lower.getTable()[slot];
    Place place;
    if (lower.isChildMaskOn(slot))
      place.leaf = entry.getChild();
    else
      place.value = entry.getValue(), place.level = 2, place.active = lower.isValueMaskOn(slot);
    return place;
  }

private:
  /// What was found at the place of a node.
  struct Known {
    Lower const* lower = nullptr;
    Coord corner = Coord::max(); ///< none that a place has
    Place wide;                  ///< without a node
  };

  // Searches go back and forth between nodes that lie side by side: eight of those each have an entry.
  Known const& known(Coord const& c) {
    Coord const corner = c & -kNodeWidths[1];
    auto const odd = [](int a) { return static_cast<unsigned>(a) / unsigned(kNodeWidths[1]) % 2; };
    Known& entry = m_known[4 * odd(c.x()) + 2 * odd(c.y()) + odd(c.z())];
    if (entry.corner != corner) find(corner, entry);
    return entry;
  }
  [[gnu::noinline]] void find(Coord const& corner, Known& entry) const {
    entry.corner = corner;
    entry.lower = m_tree.template probeConstNode<Lower>(corner);
    if (!entry.lower)
      entry.wide = {nullptr, m_tree.getValue(corner), m_tree.getValueDepth(corner), m_tree.isValueOn(corner)};
  }

  TreeT const& m_tree;
  Known m_known[8];
};

/// The places round the place of one leaf, each looked up when it is first asked for.
template <class TreeT> class LeafPlaces {
public:
  using Value = typename TreeT::ValueType;
  using Digest = LeafDigest<Value>;
  using Search = PlaceSearch<TreeT>;

  /// What a place has to say.
  struct Place {
    Digest const* digest; ///< of the leaf there; null without one
    Value value;          ///< without a leaf
    bool isNarrow;        ///< whether the tile is known to be as wide as a leaf
  };

  /// @param digests By the numbers that leaves have as their transient data.
  LeafPlaces(Search& search, Digest const* digests, Coord const& origin)
      : m_search(search)
      , m_digests(digests)
      , m_origin(origin)
      , m_lower(search.lower(origin)) {}

  /// The place x, y, z leaves away, each -1, 0 or 1.
  Place const& at(int x, int y, int z) {
    auto const n = static_cast<unsigned>(9 * (x + 1) + 3 * (y + 1) + z + 1);
    if (!(m_known >> n & 1)) lookUp(n, x, y, z);
    return m_places[n];
  }

  /// Whether all voxels of a block, and the layer of voxels beyond its high sides, hold one value: then every
  /// blend that begins in the block gives that value.
  /// @param block In blocks from the leaf's origin, each -1, 0 or 1.
  bool isUniform(int x, int y, int z) {
    Value const first = valueAt(x, y, z);
    bool const inLeaf = at(x >> 1, y >> 1, z >> 1).digest;
    int const leaving =
        4 * (x & 1) + 2 * (y & 1) + (z & 1); // the axes on which the place ends with the block
    // The few voxels beyond edges first: where values change, they mostly tell.
    for (int layer = 7; layer >= 0; --layer) {
      if (!inLeaf && !(layer & leaving)) continue; // in the same tile, which is of one value
      if (!holds(x + (layer >> 2), y + (layer >> 1 & 1), z + (layer & 1), layer, first)) return false;
    }
    return true;
  }
  /// The first voxel of a block.
  Value const& valueAt(int x, int y, int z) {
    Place const& place = at(x >> 1, y >> 1, z >> 1);
    return place.digest ? place.digest->first[numberIn(x, y, z)] : place.value;
  }

private:
  using Lower = typename Search::Lower;

  static int numberIn(int x, int y, int z) { return 4 * (x & 1) + 2 * (y & 1) + (z & 1); }
  bool holds(int x, int y, int z, int layer, Value const& wanted) {
    Place const& place = at(x >> 1, y >> 1, z >> 1);
    return place.digest ? place.digest->holds(numberIn(x, y, z), layer, wanted)
                        : sameBits(place.value, wanted);
  }
  [[gnu::noinline]] void lookUp(unsigned n, int x, int y, int z) {
    m_known |= 1u << n;
    Coord const corner = m_origin.offsetBy(kLeafWidth * x, kLeafWidth * y, kLeafWidth * z);
    auto const apart = [&](int a) {
      return static_cast<unsigned>(corner[a]) ^ static_cast<unsigned>(m_origin[a]);
    };
    bool const sameNode = (apart(0) | apart(1) | apart(2)) < unsigned(kNodeWidths[1]);
    auto const found =
        m_lower && sameNode ? Search::at(*m_lower, Lower::coordToOffset(corner)) : m_search.at(corner);
    Digest const* const digest = found.leaf ? m_digests + found.leaf->transientData() : nullptr;
    std::construct_at(&m_places[n], Place{digest, found.value, found.level == 2});
  }

  Search& m_search;
  Digest const* m_digests;
  Coord m_origin;
  Lower const* m_lower; ///< the node that the leaf's place is in, if it is that fine
  std::uint32_t m_known = 0;
  union { // made when they are asked for
    Place m_places[27];
  };
};

} // namespace VLN::Interop
