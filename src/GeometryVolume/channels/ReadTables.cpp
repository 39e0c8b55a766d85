#include "GeometryVolume/channels/detail/ReadTables.h"

#include "GeometryVolume/channels/ElementSizeImpl.h"
#include "GeometryVolume/channels/ManyReadsImpl.h"
#include "GeometryVolume/channels/detail/BlockCursor.h"

#include <algorithm>
#include <limits>
#include <stdexcept>

namespace VLN::TileTree3D::Internal {

namespace {
/// Cells for each tile of the deepest depth at most, so that the table stays small beside the tiles.
constexpr std::uint64_t kCellsPerTile = 4;
constexpr std::uint64_t kFewCells = 4096;
} // namespace

template <class TraitsT> void ReadTables<TraitsT>::chooseCells(Container<TraitsT> const& tree) {
  bbox<int3, int> box;
  tree.tileSpaceBounds(TraitsT::kMaxDepth, box);
  std::uint64_t const wanted =
      std::max(kFewCells, kCellsPerTile * static_cast<std::uint64_t>(tree.tileCount(TraitsT::kMaxDepth)));
  // At depth 0 the whole domain is one cell.
  for (m_cellDepth = kBlockDepth; m_cellDepth >= 0; --m_cellDepth) {
    std::uint64_t cells = 1;
    for (std::size_t a = 0; a < 3; ++a) {
      auto const axis = static_cast<int>(a);
      std::uint32_t const first = TraitsT::quotient(TraitsT::offset(box.min[axis]), m_cellDepth);
      // The upper corner is exclusive.
      std::uint32_t const last = TraitsT::quotient(TraitsT::offset(box.max[axis]) - 1, m_cellDepth);
      m_origin[a] = first, m_size[a] = last - first + 1;
      m_low[a] = static_cast<std::uint32_t>(TraitsT::align(box.min[axis], m_cellDepth));
      cells = std::min(cells * m_size[a], std::uint64_t(1) << 32);
    }
    if (cells > wanted) continue;
    m_cells.assign(cells, 0);
    return;
  }
}

template <class TraitsT>
auto ReadTables<TraitsT>::blockInNodes(int i, int j, int k) const noexcept -> Block const* {
  std::uint32_t const u[3] = {TraitsT::offset(i), TraitsT::offset(j), TraitsT::offset(k)};
  std::size_t cell = 0;
  bool inside = true;
  for (std::size_t a = 3; a-- > 0;) {
    std::uint32_t const q = TraitsT::quotient(u[a], m_cellDepth) - m_origin[a];
    inside &= q < m_size[a];
    cell = cell * m_size[a] + q;
  }
  if (!inside) return &noBlock();
  std::int32_t id = m_cells[cell];
  for (int d = m_cellDepth + 1; d <= kBlockDepth; ++d) id = m_nodes[id][slot(u, d)];
  return &m_blocks[id];
}

template <class TraitsT>
auto ReadTables<TraitsT>::fetch(Block const& here, Block const* fetched, int i, int j, int k,
                                std::size_t tileBytes) const noexcept -> Block const* {
  constexpr std::size_t kLine = 64;
  Block const* const ahead = block(i, j, k);
  // Not a function for one block: the compiler takes one that does nothing but fetch ahead for one without
  // effect.
  for (auto const* b = &here == fetched ? ahead : &here;; b = ahead) {
    for (void const* tile : b->tiles) {
      if (!tile) continue;
      // By four lines, the size of most tiles.
      for (std::size_t at = 0; at < tileBytes; at += 4 * kLine) {
        auto const* const line = static_cast<char const*>(tile) + at;
        __builtin_prefetch(line);
        __builtin_prefetch(line + kLine);
        __builtin_prefetch(line + 2 * kLine);
        __builtin_prefetch(line + 3 * kLine);
      }
    }
    if (b == ahead) return ahead;
  }
}

template <class TraitsT> auto ReadTables<TraitsT>::makeBlock(int3 const& corner) -> Block& {
  std::uint32_t const u[3] = {TraitsT::offset(corner.x), TraitsT::offset(corner.y),
                              TraitsT::offset(corner.z)};
  std::size_t cell = 0;
  for (std::size_t a = 3; a-- > 0;)
    cell = cell * m_size[a] + (TraitsT::quotient(u[a], m_cellDepth) - m_origin[a]);
  constexpr auto kMost = static_cast<std::size_t>(std::numeric_limits<std::int32_t>::max());
  // Entries are named by table and place, since the tables move as they grow.
  bool inCells = true;
  std::size_t at = cell, within = 0;
  auto const entry = [&]() -> std::int32_t& { return inCells ? m_cells[at] : m_nodes[at][within]; };
  for (int d = m_cellDepth + 1; d <= kBlockDepth; ++d) {
    if (entry() == 0) {
      if (m_nodes.size() == kMost) throw std::length_error("list too long");
      m_nodes.emplace_back();
      entry() = static_cast<std::int32_t>(m_nodes.size() - 1);
    }
    at = static_cast<std::size_t>(entry()), within = slot(u, d), inCells = false;
  }
  if (entry() == 0) {
    if (m_blocks.size() == kMost) throw std::length_error("list too long");
    m_blocks.emplace_back();
    entry() = static_cast<std::int32_t>(m_blocks.size() - 1);
  }
  return m_blocks[entry()];
}

template <class TraitsT>
ReadTables<TraitsT>::ReadTables(Container<TraitsT> const& tree,
                                FunctionRef<void const*(std::int64_t tile)> elements)
    : m_nodes(1)
    , m_blocks(1) {
  constexpr int kDepth = TraitsT::kMaxDepth;
  std::int64_t const count = tree.tileCount(kDepth);
  if (count == 0) return;
  chooseCells(tree);
  m_blocks.reserve(count / 4 + 1);
  for (std::int64_t n = 0; n < count; ++n) {
    auto const& tile = tree.tile(n, kDepth);
    if (!tile.valid()) continue;
    int3 const corner = tile.tijk();
    std::uint32_t const u[3] = {TraitsT::offset(corner.x), TraitsT::offset(corner.y),
                                TraitsT::offset(corner.z)};
    makeBlock(corner).tiles[slot(u, kDepth)] = elements(n);
  }
}

template <class TraitsT>
void ReadTables<TraitsT>::read(int3 const* positions, std::size_t count, ElementRows const& rows,
                               void* values, FunctionRef<void(std::size_t n)> missing) const {
  if constexpr (TraitsT::kTW == 2) {
    withSize(rows.elementSize, [&](auto size) {
      ManyReads<Block, decltype(size)> reads(rows, size);
      reads.read(
          std::span(positions, count),
          [&](int3 const& p) {
            if (m_cellDepth == kBlockDepth) __builtin_prefetch(cellIfBlocks(p.x, p.y, p.z));
          },
          [&](int3 const& p) { return block(p.x, p.y, p.z); }, values, missing);
    });
  } else {
    BlockCursor<TraitsT> cursor(*this);
    for (std::size_t n = 0; n < count; ++n) {
      FinestSample const sample = cursor.find(positions[n].x, positions[n].y, positions[n].z);
      auto const* const tile = static_cast<char const*>(sample.elements);
      if (tile)
        std::memcpy(static_cast<char*>(values) + n * rows.elementSize,
                    tile + rows.offset(sample.i, sample.j, sample.k), rows.elementSize);
      else
        missing(n);
    }
  }
}

template <class TraitsT> std::uint64_t ReadTables<TraitsT>::memUsage() const {
  return sizeof(*this) + m_cells.capacity() * sizeof(std::int32_t) + m_nodes.capacity() * sizeof(Node) +
         m_blocks.capacity() * sizeof(Block);
}

#define VLN_INSTANTIATE(TraitsT) template class VLN_API ReadTables<TraitsT>;
VLN_FOR_EACH_SHAPE(VLN_INSTANTIATE)

} // namespace VLN::TileTree3D::Internal
