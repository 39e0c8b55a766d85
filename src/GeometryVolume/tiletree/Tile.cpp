#include "GeometryVolume/tiletree/Tile.h"

#include <algorithm>
#include <ostream>

namespace VLN::TileTree3D {

namespace {

using Wide = std::int64_t;

} // namespace

template <class TraitsT, int N> VoxelCoord Tile<TraitsT, N>::parentVoxelCoord() const {
  int const d = depth() - 1;
  if (d < 0) return {};
  return {TraitsT::align(ti(), d), TraitsT::align(tj(), d), TraitsT::align(tk(), d), d};
}

template <class TraitsT, int N> int3 Tile<TraitsT, N>::parentIJK() const {
  if (depth() <= 0) return {0, 0, 0};
  auto const parent = static_cast<std::uint32_t>(parentTileVoxelWidth());
  auto const own = static_cast<std::uint32_t>(tileVoxelWidth());
  int3 p{0, 0, 0};
  for (int a = 0; a < 3; ++a)
    p[a] = static_cast<int>(distance(this->m_tijk[a], TraitsT::kMinTileCoord) % parent / own);
  return p;
}

template <class TraitsT, int N> int Tile<TraitsT, N>::childCount() const {
  if (atMaxDepth()) return 0;
  return static_cast<int>(
      std::count_if(this->children(), this->children() + kTileSize, [](auto c) { return c >= 0; }));
}

template <class TraitsT, int N> bool Tile<TraitsT, N>::isLeaf() const {
  return atMaxDepth() || childCount() == 0;
}

template <class TraitsT, int N> bool Tile<TraitsT, N>::hasLeaves() const {
  if (atMaxDepth()) return true;
  return valid() && childCount() < kTileSize;
}

template <class TraitsT, int N> bool Tile<TraitsT, N>::contains(float3 const& p) const {
  float const w = static_cast<float>(tileVoxelWidth());
  for (int a = 0; a < 3; ++a) {
    float const low = static_cast<float>(this->m_tijk[a]);
    if (!(low <= p[a] && p[a] < low + w)) return false;
  }
  return true;
}

template <class TraitsT, int N> bool Tile<TraitsT, N>::intersects(bbox<int3, int> const& box) const {
  Wide const w = tileVoxelWidth();
  for (int a = 0; a < 3; ++a) {
    Wide const low = this->m_tijk[a];
    if (std::max<Wide>(box.min[a], low) > std::min<Wide>(box.max[a], low + w)) return false;
  }
  return true;
}

template <class TraitsT, int N>
bool Tile<TraitsT, N>::childIntersects(bbox<int3, int> const& box, int3 const& ijk) const {
  Wide const v = voxelWidth();
  for (int a = 0; a < 3; ++a) {
    Wide const low = this->m_tijk[a] + v * ijk[a];
    if (std::max<Wide>(box.min[a], low) > std::min<Wide>(box.max[a], low + v - 1)) return false;
  }
  return true;
}

template <class TraitsT, int N> bool Tile<TraitsT, N>::isContainedWithin(bbox<int3, int> const& box) const {
  Wide const w = tileVoxelWidth();
  for (int a = 0; a < 3; ++a) {
    if (this->m_tijk[a] < box.min[a] || this->m_tijk[a] + w > box.max[a]) return false;
  }
  return true;
}

template <class TraitsT, int N>
bool Tile<TraitsT, N>::childIsContainedWithin(bbox<int3, int> const& box, int3 const& ijk) const {
  Wide const v = voxelWidth();
  for (int a = 0; a < 3; ++a) {
    Wide const low = this->m_tijk[a] + v * ijk[a];
    if (low < box.min[a] || low + v - 1 > box.max[a]) return false;
  }
  return true;
}

template <class TraitsT, int N> bool Tile<TraitsT, N>::isAncestorOf(Tile const& other) const {
  if (depth() >= other.depth()) return false;
  Wide const v = voxelWidth();
  for (int a = 0; a < 3; ++a) {
    Wide const slot = (Wide(other.m_tijk[a]) - this->m_tijk[a]) / v;
    if (slot < 0 || slot >= kTileWidth) return false;
  }
  return true;
}

template <class TraitsT, int N> void Tile<TraitsT, N>::tileSpaceBounds(bbox<int3, int>& box) const {
  // The far corner of the domain's last tile is kMaxTileCoord + 1, which int32 holds.
  int const w = tileVoxelWidth();
  box.grow(this->m_tijk);
  box.grow({ti() + w, tj() + w, tk() + w});
}

template <class TraitsT, int N>
void Tile<TraitsT, N>::tileSpaceBounds(int3 const& ijk, bbox<int3, int>& box) const {
  box.grow(childTIJK(ijk));
  box.grow(childTIJK(ijk + int3{1, 1, 1}));
}

template <class TraitsT, int N> bool Tile<TraitsT, N>::isOK() const {
  if (depth() < -1 || depth() > kMaxDepth) return false;
  if (index() < -1 || parentIndex() < -1) return false;
  if (depth() == 0 && parentIndex() != -1) return false;
  return TraitsT::inDomain(ti(), tj(), tk());
}

template <class TraitsT, int N> void Tile<TraitsT, N>::dump(std::ostream& os) const {
  void const* const self = this;
  Wide const d = depth(), p = parentIndex(), n = index();
  os << "================\n";
  os << self << " this->m_depth: " << d << '\n';
  os << self << " this->m_parent: " << p << '\n';
  os << self << " this->m_index: " << n << '\n';
  os << self << " this->m_tijk.x: " << ti() << '\n';
  os << self << " this->m_tijk.y: " << tj() << '\n';
  os << self << " this->m_tijk.z: " << tk() << '\n';
  os << self << " this->m_valid: " << valid() << '\n';
  os << self << " this->children() = " << static_cast<void const*>(this->children()) << '\n';
  os << self << " this->m_branchSize = " << branchSize() << '\n';
  auto const check = [&](bool passes, char const* text) {
    if (!passes) os << " check !(" << text << ") failed\n";
  };
  check(d >= -1 && d <= kMaxDepth, "this->m_depth>=-1 && this->m_depth<=kMaxDepth");
  check(p >= -2 && p <= 1000000000, "this->m_parent>=-2 && this->m_parent<=1000000000");
  check(n >= -2 && n <= 1000000000, "this->m_index>=-2 && this->m_index<=1000000000");
  check((d == 0 && p < 0) || (d > 0 && p >= 0) || d == -1,
        "(this->m_depth==0&&this->m_parent<0)||(this->m_depth>0&&this->m_parent>=0)||this->m_depth==-1");
  check(TraitsT::inDomain(ti()), "this->m_tijk.x>=kMinTileCoord && this->m_tijk.x<=kMaxTileCoord");
  check(TraitsT::inDomain(tj()), "this->m_tijk.y>=kMinTileCoord && this->m_tijk.y<=kMaxTileCoord");
  check(TraitsT::inDomain(tk()), "this->m_tijk.z>=kMinTileCoord && this->m_tijk.z<=kMaxTileCoord");
  os << "================\n";
}

#define VLN_INSTANTIATE(TraitsT)                                                                             \
  template class VLN_API Tile<TraitsT, TraitsT::kTileSize>;                                                  \
  template class VLN_API Tile<TraitsT, 1>;
VLN_FOR_EACH_SHAPE(VLN_INSTANTIATE)

} // namespace VLN::TileTree3D
