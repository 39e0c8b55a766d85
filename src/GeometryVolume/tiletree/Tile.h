// Tile: the node of the tree, a plain record held by value in one array for each depth.
//
//   | m_tijk 12 | m_depth 4 | m_index 8 | m_parent 8 | m_branchSize 8 | m_valid 1 (+7) | child table 8 |   56
//   bytes
//
// The child table is a heap block of its own, one int64 for each voxel; tiles of the deepest depth have none.
#pragma once

#include "GeometryVolume/core/Export.h"
#include "GeometryVolume/tiletree/Traits.h"
#include "GeometryVolume/tiletree/TreeIndex.h"

#include <cstdint>
#include <iosfwd>
#include <utility>

namespace VLN::TileTree3D {

using Velorn::Math::bbox;
using Velorn::Math::double3;
using Velorn::Math::float3;
using Velorn::Math::int3;

/// Storage of a tile with a table of N children.
template <int N> class TileBinaryNonCompatible {
public:
  TileBinaryNonCompatible()
      : m_tijk{0, 0, 0} {}
  /// Clones the child table.
  TileBinaryNonCompatible(TileBinaryNonCompatible const& b)
      : m_tijk(b.m_tijk)
      , m_depth(b.m_depth)
      , m_index(b.m_index)
      , m_parent(b.m_parent)
      , m_branchSize(b.m_branchSize)
      , m_valid(b.m_valid) {
    if (b.m_children) {
      m_children = new std::int64_t[N];
      for (int n = 0; n < N; ++n) m_children[n] = b.m_children[n];
    }
  }
  TileBinaryNonCompatible& operator=(TileBinaryNonCompatible b) {
    std::swap(m_tijk, b.m_tijk);
    std::swap(m_depth, b.m_depth);
    std::swap(m_index, b.m_index);
    std::swap(m_parent, b.m_parent);
    std::swap(m_branchSize, b.m_branchSize);
    std::swap(m_valid, b.m_valid);
    std::swap(m_children, b.m_children);
    return *this;
  }
  ~TileBinaryNonCompatible() { delete[] m_children; }

  /// Makes the child table, all entries -1.
  void initData() {
    if (!m_children) m_children = new std::int64_t[N];
    for (int n = 0; n < N; ++n) m_children[n] = -1;
  }
  /// Marks the tile as dead and frees its child table; the other fields stay readable.
  void invalidate() {
    m_valid = false;
    delete[] m_children;
    m_children = nullptr;
  }
  void setIndex(std::int64_t index) { m_index = index; }
  void setBranchSize(std::int64_t size) { m_branchSize = size; }
  TreeIndex treeIndex() const { return {m_index, m_depth}; }

  std::int64_t* children() { return m_children; }
  std::int64_t const* children() const { return m_children; }

  /// The record, and the table when there is one, into both outputs.
  void memUse(std::uint64_t& used, std::uint64_t& allocated) const {
    used = allocated = sizeof(TileBinaryNonCompatible) + (m_children ? N * sizeof(std::int64_t) : 0);
  }

protected:
  int3 m_tijk;
  std::int32_t m_depth = -1;
  std::int64_t m_index = -1;
  std::int64_t m_parent = -1;
  std::int64_t m_branchSize = N;
  bool m_valid = false;

private:
  std::int64_t* m_children = nullptr;
};

/// A cube of kTW x kTW x kTW voxels at one depth. Each voxel is a leaf or is refined by one child tile.
/// @space All coordinates are tile space; slots count voxels with i fastest.
/// @threads No synchronisation: tiles are read concurrently, parallel writers touch disjoint tiles.
template <class TraitsT, int N> class Tile : public TileBinaryNonCompatible<N> {
  using Storage = TileBinaryNonCompatible<N>;

public:
  static constexpr int kTileWidth = TraitsT::kTW;
  static constexpr int kTileSize = TraitsT::kTileSize;
  static constexpr int kMaxDepth = TraitsT::kMaxDepth;

  Tile() { this->m_branchSize = kTileSize; }
  Tile(Tile const&) = default;
  /// Clones, exactly as the copy does.
  Tile(Tile&& other)
      : Tile(static_cast<Tile const&>(other)) {}
  Tile& operator=(Tile other) {
    Storage::operator=(static_cast<Storage&>(other));
    return *this;
  }
  ~Tile() = default;

  // Fields
  int depth() const { return this->m_depth; }
  std::int64_t index() const { return this->m_index; }
  std::int64_t parentIndex() const { return this->m_parent; }
  int3 const& tijk() const { return this->m_tijk; }
  int ti() const { return this->m_tijk.x; }
  int tj() const { return this->m_tijk.y; }
  int tk() const { return this->m_tijk.z; }
  bool valid() const { return this->m_valid; }
  std::int64_t branchSize() const { return this->m_branchSize; }
  VoxelCoord voxelCoord() const { return {ti(), tj(), tk(), depth()}; }
  bool isRoot() const { return this->m_parent < 0; }
  bool atMaxDepth() const { return this->m_depth == kMaxDepth; }

  // Widths, by depth and of this tile
  static int tileWidth() { return kTileWidth; }
  static int tileSize() { return kTileSize; }
  static int tileDataWidth() { return TraitsT::kTDW; }
  static int tileDataSize() { return TraitsT::kTileDataSize; }
  static int tileVoxelWidth(int d) { return TraitsT::width(d); }
  static int voxelWidth(int d) { return TraitsT::width(d + 1); }
  static int voxelDataWidth(int d) { return TraitsT::width(d) / TraitsT::kTDW; }
  static int childTileVoxelWidth(int d) { return tileVoxelWidth(d + 1); }
  static int childVoxelWidth(int d) { return voxelWidth(d + 1); }
  static int childVoxelDataWidth(int d) { return voxelDataWidth(d + 1); }
  static int parentTileVoxelWidth(int d) { return tileVoxelWidth(d - 1); }
  static int parentVoxelWidth(int d) { return voxelWidth(d - 1); }
  static int parentVoxelDataWidth(int d) { return voxelDataWidth(d - 1); }
  int tileVoxelWidth() const { return tileVoxelWidth(depth()); }
  int voxelWidth() const { return voxelWidth(depth()); }
  int voxelDataWidth() const { return voxelDataWidth(depth()); }
  int childTileVoxelWidth() const { return childTileVoxelWidth(depth()); }
  int childVoxelWidth() const { return childVoxelWidth(depth()); }
  int childVoxelDataWidth() const { return childVoxelDataWidth(depth()); }
  int parentTileVoxelWidth() const { return parentTileVoxelWidth(depth()); }
  int parentVoxelWidth() const { return parentVoxelWidth(depth()); }
  int parentVoxelDataWidth() const { return parentVoxelDataWidth(depth()); }

  // Parent
  TreeIndex parentTreeIndex() const { return {this->m_parent, depth() - 1}; }
  /// Coordinates of the parent tile, existing or not; invalid at depth 0 and above.
  VoxelCoord parentVoxelCoord() const;
  /// This tile's voxel in its parent; (0,0,0) at depth 0 and above.
  int3 parentIJK() const;

  // Children
  std::int64_t& childIndex(int slot) { return this->children()[slot]; }
  std::int64_t const& childIndex(int slot) const { return this->children()[slot]; }
  std::int64_t& childIndex(int i, int j, int k) { return childIndex(slotOf(i, j, k)); }
  std::int64_t const& childIndex(int i, int j, int k) const { return childIndex(slotOf(i, j, k)); }
  std::int64_t& childIndex(int3 const& p) { return childIndex(p.x, p.y, p.z); }
  std::int64_t const& childIndex(int3 const& p) const { return childIndex(p.x, p.y, p.z); }
  std::int64_t& childIndex(Tile const& child) { return childIndex(childI(child)); }
  std::int64_t const& childIndex(Tile const& child) const { return childIndex(childI(child)); }
  static constexpr int slotOf(int i, int j, int k) { return i + kTileWidth * (j + kTileWidth * k); }
  /// Slot of a child tile.
  int childI(Tile const& child) const {
    int3 const p = childIJK(child);
    return slotOf(p.x, p.y, p.z);
  }
  /// Position of a slot.
  static int3 childIJK(int slot) {
    int const k = slot / (kTileWidth * kTileWidth);
    return {slot % kTileWidth, slot / kTileWidth - k * kTileWidth, k};
  }
  /// The voxel that holds a tile-space point.
  int3 childIJK(int i, int j, int k) const {
    int const v = voxelWidth();
    return {offsetBy(i, ti()) / v, offsetBy(j, tj()) / v, offsetBy(k, tk()) / v};
  }
  int3 childIJK(int3 const& p) const { return childIJK(p.x, p.y, p.z); }
  int3 childIJK(Tile const& child) const { return childIJK(child.m_tijk); }
  /// The data sample that holds a tile-space point.
  int3 childDataIJK(int i, int j, int k) const {
    int const s = voxelDataWidth();
    return {offsetBy(i, ti()) / s, offsetBy(j, tj()) / s, offsetBy(k, tk()) / s};
  }
  int3 childDataIJK(int3 const& p) const { return childDataIJK(p.x, p.y, p.z); }
  /// Corner of a voxel.
  int3 childTIJK(int i, int j, int k) const {
    int const v = voxelWidth();
    return {ti() + v * i, tj() + v * j, tk() + v * k};
  }
  int3 childTIJK(int3 const& p) const { return childTIJK(p.x, p.y, p.z); }
  /// Corner of a data sample.
  int3 childDataTIJK(int i, int j, int k) const {
    int const s = voxelDataWidth();
    return {ti() + s * i, tj() + s * j, tk() + s * k};
  }
  int3 childDataTIJK(int3 const& p) const { return childDataTIJK(p.x, p.y, p.z); }
  TreeIndex childTreeIndex(int slot) const { return {childIndex(slot), depth() + 1}; }
  TreeIndex childTreeIndex(int i, int j, int k) const { return {childIndex(i, j, k), depth() + 1}; }
  TreeIndex childTreeIndex(int3 const& p) const { return {childIndex(p), depth() + 1}; }
  TreeIndex childTreeIndex(Tile const& child) const { return {childIndex(child), depth() + 1}; }
  int childCount() const;
  /// Whether no voxel is refined.
  /// @pre A live tile, or one at the deepest depth.
  bool isLeaf() const;
  bool isLeaf(int slot) const { return atMaxDepth() || childIndex(slot) < 0; }
  bool isLeaf(int i, int j, int k) const { return atMaxDepth() || childIndex(i, j, k) < 0; }
  bool isLeaf(int3 const& p) const { return isLeaf(p.x, p.y, p.z); }
  /// Whether any voxel is a leaf; false for a dead tile above the deepest depth.
  bool hasLeaves() const;

  // Extent
  /// Half-open: m_tijk <= p < m_tijk + width on all axes.
  bool contains(int i, int j, int k) const {
    auto const w = static_cast<std::uint32_t>(tileVoxelWidth());
    return distance(i, ti()) < w && distance(j, tj()) < w && distance(k, tk()) < w;
  }
  bool contains(int3 const& p) const { return contains(p.x, p.y, p.z); }
  bool contains(float3 const& p) const;
  /// A box that touches the far face counts.
  bool intersects(bbox<int3, int> const& box) const;
  /// A box that touches the voxel's far face does not count.
  bool childIntersects(bbox<int3, int> const& box, int3 const& ijk) const;
  bool isContainedWithin(bbox<int3, int> const& box) const;
  bool childIsContainedWithin(bbox<int3, int> const& box, int3 const& ijk) const;
  /// By truncating division: a deeper tile that lies less than one voxel below this tile's corner on an axis
  /// passes that axis. Ask contains() as well where that matters.
  bool isAncestorOf(Tile const& other) const;
  /// Grows the box by this tile, or by one of its voxels.
  void tileSpaceBounds(bbox<int3, int>& box) const;
  void tileSpaceBounds(int3 const& ijk, bbox<int3, int>& box) const;

  /// Walks the occupied slots of a tile.
  class ChildIterator {
  public:
    ChildIterator() = default;
    ChildIterator(int slot, std::int64_t const* table, int depth, bool reverse)
        : m_slot(slot)
        , m_table(table)
        , m_depth(depth)
        , m_reverse(reverse) {}
    int operator*() const { return m_slot; }
    TreeIndex treeIndex() const { return {m_table[m_slot], m_depth + 1}; }
    ChildIterator& operator++() {
      if (!m_table) m_slot = kTileSize - 1; // a tile without a table has no occupied slot
      do ++m_slot;
      while (m_slot < kTileSize && m_table[m_slot] < 0);
      return *this;
    }
    ChildIterator& operator--() {
      if (!m_table) m_slot = 0;
      do --m_slot;
      while (m_slot >= 0 && m_table[m_slot] < 0);
      return *this;
    }
    bool reverse() const { return m_reverse; }
    bool operator==(ChildIterator const& b) const { return m_slot == b.m_slot; }

  private:
    std::int32_t m_slot = kTileSize;
    std::int64_t const* m_table = nullptr;
    std::int32_t m_depth = -1;
    bool m_reverse = false;
  };
  ChildIterator begin() const {
    ChildIterator it(-1, this->children(), depth(), false);
    return noTable() ? end() : ++it;
  }
  ChildIterator end() const { return {kTileSize, this->children(), depth(), false}; }
  /// Descends with --.
  ChildIterator rbegin() const {
    ChildIterator it(kTileSize, this->children(), depth(), true);
    return noTable() ? rend() : --it;
  }
  ChildIterator rend() const { return {-1, this->children(), depth(), true}; }

  // Checks
  bool isOK() const;
  /// Writes the fields, and a line for each failed check; the checks are looser than those of isOK().
  void dump(std::ostream& os) const;

protected:
  template <class> friend class Container;
  template <class> friend class ContainerBuilder;
  template <class> friend class ContainerGrowth;

  /// Makes this record a live tile.
  void init(std::int64_t parent, int i, int j, int k, int depth, std::int64_t index) {
    this->m_tijk = {i, j, k};
    this->m_depth = depth;
    this->m_index = index;
    this->m_parent = parent;
    this->m_branchSize = kTileSize;
    this->m_valid = true;
    if (depth != kMaxDepth) this->initData();
  }
  void setParentIndex(std::int64_t parent) { this->m_parent = parent; }

private:
  bool noTable() const { return atMaxDepth() || !this->children(); }
  static std::uint32_t distance(int c, int corner) {
    return static_cast<std::uint32_t>(c) - static_cast<std::uint32_t>(corner);
  }
  /// c - corner, defined for every pair of coordinates.
  static int offsetBy(int c, int corner) { return static_cast<int>(distance(c, corner)); }
};

} // namespace VLN::TileTree3D
