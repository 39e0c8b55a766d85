#include "GeometryVolume/tiletree/DerivedCachesImpl.h"

#include "GeometryVolume/tiletree/TileHalo.h"

#include <bit>
#include <cmath>

namespace VLN::TileTree3D {

namespace {

/// Cells of the acceleration grid along an axis at most.
constexpr std::uint32_t kMaxGridCells = 64;

/// max - min, defined for the empty box too, whose extent wraps to 2.
std::uint32_t extent(bbox<int3, int> const& box, int axis) {
  return static_cast<std::uint32_t>(box.max[axis]) - static_cast<std::uint32_t>(box.min[axis]);
}

/// Runs `body(tile)` for each live tile of a depth, with an accessor for each range.
template <class TraitsT, class Body>
void forEachLiveTile(Container<TraitsT> const& tree, int depth, Body const& body) {
  parallelFor(0, tree.tileCount(depth),
              [&](std::int64_t begin, std::int64_t end) {
                auto accessor = tree.tileAccessor();
                for (std::int64_t n = begin; n < end; ++n) {
                  if (tree.tile(n, depth).valid()) body(tree.tile(n, depth), accessor);
                }
              },
              {.grain = 256});
}

/// Appends fields of a few bits each, from the low end of each byte.
class BitWriter {
public:
  void write(std::uint32_t value, int bits) {
    for (int b = 0; b < bits; ++b, ++m_bit) {
      if (m_bit % 8 == 0) m_bytes.push_back(0);
      m_bytes.back() = static_cast<std::uint8_t>(m_bytes.back() | (value >> b & 1) << (m_bit % 8));
    }
  }
  std::vector<std::uint8_t> const& bytes() const { return m_bytes; }

private:
  std::vector<std::uint8_t> m_bytes;
  int m_bit = 0;
};

template <class TraitsT>
TileHalo<TraitsT> haloOf(typename Container<TraitsT>::TileType const& tile,
                         ConstTileAccessorOf<TraitsT> const& accessor) {
  TileHalo<TraitsT> halo{};
  for (int n = 0; n < kNeighborCount; ++n) {
    auto const at = static_cast<std::size_t>(n);
    halo.neighbors[at] = accessor.treeIndexNeighbor(tile, static_cast<NeighborDirection>(n));
    bool const found = halo.neighbors[at].valid();
    halo.levelDifference[at] = static_cast<std::int8_t>(found ? tile.depth() - halo.neighbors[at].depth : -1);
  }
  return halo;
}

template <class TraitsT>
std::vector<std::uint8_t> packHalo(typename Container<TraitsT>::TileType const& tile,
                                   TileHalo<TraitsT> const& halo, HaloCompression const& table) {
  std::uint32_t sameDepth = 0, coarser = 0;
  for (int n = 0; n < kNeighborCount; ++n) {
    int const levels = n == kNeighborSelf ? -1 : halo.levelDifference[n];
    sameDepth += levels == 0;
    coarser += levels > 0;
  }
  BitWriter out;
  out.write(sameDepth, table.sameDepthBits);
  out.write(coarser, table.coarserBits);
  for (int n = 0; n < kNeighborCount; ++n) {
    if (n != kNeighborSelf && halo.levelDifference[n] == 0) out.write(static_cast<std::uint32_t>(n), 5);
  }
  for (int n = 0; n < kNeighborCount; ++n) {
    int const levels = halo.levelDifference[n];
    if (levels <= 0) continue;
    out.write(static_cast<std::uint32_t>(n), 5);
    out.write(static_cast<std::uint32_t>(levels > 3 ? 0 : levels), 2);
    int const weight = nearestHaloWeight(haloWeight<TraitsT>(tile, n, levels));
    out.write(static_cast<std::uint32_t>(weight), table.weightBits);
  }
  return out.bytes();
}

} // namespace

template <class TraitsT>
float haloWeight(Tile<TraitsT, TraitsT::kTileSize> const& tile, int direction, int levels) {
  int3 const d = neighborOffset(direction);
  std::int64_t const fine = tile.voxelDataWidth();
  std::int64_t const coarse = Container<TraitsT>::voxelDataWidth(tile.depth() - levels);
  double weight = 1.0;
  for (int a = 0; a < 3; ++a) {
    std::int64_t const sample = d[a] < 0 ? -1 : d[a] > 0 ? TraitsT::kTDW : 0;
    std::int64_t const position = std::int64_t(tile.tijk()[a]) - TraitsT::kMinTileCoord + fine * sample;
    std::int64_t const within = ((position % coarse) + coarse) % coarse;
    weight *= 1.0 - static_cast<double>(within) / static_cast<double>(coarse);
  }
  return static_cast<float>(weight);
}

namespace {

/// A dense box of tile indices at one depth; without cells where no depth qualifies.
struct Grid {
  int depth = -1;
  std::int32_t cellWidth = 1;
  int3 origin{0, 0, 0}, extent{0, 0, 0};
  std::array<std::int32_t, 3> size{0, 0, 0};
  std::vector<std::int64_t> tiles;
};

template <class TraitsT> Grid computeGrid(Container<TraitsT> const& tree, int maxDepth) {
  Grid grid;
  for (int d = std::min(maxDepth, TraitsT::kMaxDepth); d >= 1; --d) {
    if (tree.tileCount(d) == 0) continue;
    bbox<int3, int> box;
    tree.tileSpaceBounds(d, box);
    if (box.empty()) continue;
    auto const w = static_cast<std::uint32_t>(TraitsT::width(d));
    std::uint32_t const largest = std::max({extent(box, 0), extent(box, 1), extent(box, 2)});
    if (largest / w > kMaxGridCells) continue;

    grid.depth = d;
    grid.origin = box.min;
    grid.cellWidth = static_cast<std::int32_t>(w);
    std::size_t cells = 1;
    for (int a = 0; a < 3; ++a) {
      grid.extent[a] = static_cast<int>(extent(box, a));
      grid.size[a] = static_cast<std::int32_t>(extent(box, a) / w);
      cells *= extent(box, a) / w;
    }
    grid.tiles.assign(cells, -1);
    for (std::int64_t n = 0; n < tree.tileCount(d); ++n) {
      auto const& tile = tree.tile(n, d);
      if (!tile.valid()) continue;
      std::size_t at = 0;
      for (int a = 2; a >= 0; --a) {
        auto const cell =
            (static_cast<std::uint32_t>(tile.tijk()[a]) - static_cast<std::uint32_t>(box.min[a])) / w;
        at = at * static_cast<std::size_t>(grid.size[a]) + cell;
      }
      grid.tiles[at] = n;
    }
    break;
  }
  return grid;
}

/// Marks the cells that hold roots deeper than the grid: those are to be asked of the tree.
template <class TraitsT>
void markDeeperRoots(Container<TraitsT> const& tree, TileLookupTable<TraitsT>& table) {
  for (auto it = tree.cbeginRoots(); it != tree.cendRoots(); ++it) {
    if (it->second.depth <= table.gridDepth) continue;
    std::size_t cell = 0;
    bool inside = true;
    for (int a = 2; a >= 0; --a) {
      std::uint32_t const c =
          TraitsT::quotient(TraitsT::offset(it->first.ijk()[a]), table.gridDepth) - table.first[a];
      inside = inside && c < table.size[a];
      cell = cell * table.size[a] + c;
    }
    if (inside) table.cells[cell] = table.kUnknown;
  }
}

/// The deepest tile at or above the grid's depth, for each cell.
template <class TraitsT>
void fillCells(Container<TraitsT> const& tree, Grid const& grid, TileLookupTable<TraitsT>& table) {
  std::int64_t const rows = std::int64_t(grid.size[1]) * grid.size[2];
  parallelFor(0, rows, [&](std::int64_t begin, std::int64_t end) {
    auto accessor = tree.tileAccessor();
    for (std::int64_t row = begin; row < end; ++row)
      for (int i = 0; i < grid.size[0]; ++i) {
        auto const cell = static_cast<std::size_t>(row * grid.size[0] + i);
        TreeIndex at{grid.tiles[cell], grid.depth};
        if (at.index < 0) {
          int const w = grid.cellWidth;
          at = accessor.treeIndex(
              grid.origin.x + i * w, grid.origin.y + static_cast<int>(row % grid.size[1]) * w,
              grid.origin.z + static_cast<int>(row / grid.size[1]) * w, grid.depth, false);
        }
        if (at.index >= 0)
          table.cells[cell] = static_cast<std::int32_t>(at.index * table.kDepthUnit + at.depth);
      }
  });
}

/// The deepest tile down to the table's last depth, for each place below a tile of the grid's depth.
template <class TraitsT> void fillPlaces(Container<TraitsT> const& tree, TileLookupTable<TraitsT>& table) {
  int const g = table.gridDepth, width = static_cast<int>(table.placeWidth);
  auto const size = static_cast<int>(table.blockSize);
  table.places.resize(tree.tileCount(g) * size);
  parallelFor(0, tree.tileCount(g), [&](std::int64_t begin, std::int64_t end) {
    for (std::int64_t n = begin; n < end; ++n) {
      if (!tree.tile(n, g).valid()) continue;
      auto* const block = &table.places[n * size];
      for (int place = 0; place < size; ++place) {
        int const p[3] = {place % width, place / width % width, place / (width * width)};
        TreeIndex at{n, g};
        for (int divisor = width / TraitsT::kTW; at.depth < table.lastDepth; divisor /= TraitsT::kTW) {
          auto const digit = [&](int a) { return p[a] / divisor % TraitsT::kTW; };
          TreeIndex const child = tree.tile(at).childTreeIndex(digit(0), digit(1), digit(2));
          if (child.index < 0) break;
          at = child;
        }
        block[place] = static_cast<std::int32_t>(at.index * std::int64_t(table.kLevelUnit) + (at.depth - g));
      }
    }
  });
}

template <class TraitsT>
std::shared_ptr<TileLookupTable<TraitsT> const> computeLookupTable(Container<TraitsT> const& tree,
                                                                   Grid const& grid) {
  using Table = TileLookupTable<TraitsT>;
  int const g = grid.depth, last = std::min(g + Table::kLevels, TraitsT::kMaxDepth);
  for (int d = 0; d <= last; ++d) {
    if (tree.tileCount(d) > (d <= g ? Table::kMostCellTiles : Table::kMostTiles)) return nullptr;
  }
  auto table = std::make_shared<Table>();
  table->gridDepth = g, table->lastDepth = last;
  table->levels = static_cast<std::uint32_t>(last - g);
  table->placeWidth = static_cast<std::uint32_t>(TraitsT::width(g) / TraitsT::width(last));
  table->blockSize = table->placeWidth * table->placeWidth * table->placeWidth;
  for (int a = 0; a < 3; ++a) {
    table->first[a] = TraitsT::quotient(TraitsT::offset(grid.origin[a]), g);
    table->size[a] = static_cast<std::uint32_t>(grid.size[a]);
    table->low[a] = static_cast<std::uint32_t>(grid.origin[a]);
  }
  auto const lastWidth = static_cast<std::uint32_t>(TraitsT::width(last));
  table->placeBits = static_cast<std::uint32_t>(std::countr_zero(lastWidth));
  table->placeMask = table->placeWidth - 1;
  table->widthMask = ~(lastWidth - 1);
  table->cells.assign(grid.tiles.size(), Table::kNoTile);
  markDeeperRoots(tree, *table);
  fillCells(tree, grid, *table);
  fillPlaces(tree, *table);
  return table;
}

} // namespace

template <class TraitsT>
void buildAccelerationGrid(Container<TraitsT> const& tree, ContainerData<TraitsT>& data, int maxDepth) {
  Grid grid = computeGrid(tree, maxDepth);
  if (grid.depth < 0) return;
  auto table = computeLookupTable(tree, grid);
  data.m_gridOrigin = grid.origin;
  data.m_gridCellWidth = grid.cellWidth;
  data.m_gridExtent = grid.extent;
  data.m_gridSize = grid.size;
  data.m_gridTable = std::move(grid.tiles);
  data.m_gridDepth = grid.depth; // lookups use it from here on
  data.setLookupTable(std::move(table));
}

template <class TraitsT>
std::shared_ptr<TileLookupTable<TraitsT> const> buildLookupTable(Container<TraitsT> const& tree) {
  Grid const grid = computeGrid(tree, TraitsT::kMaxDepth);
  return grid.depth < 0 ? nullptr : computeLookupTable(tree, grid);
}

template <class TraitsT>
std::shared_ptr<typename ContainerData<TraitsT>::NeighborTable const>
computeTileNeighbors(Container<TraitsT> const& tree) {
  auto table = std::make_shared<typename ContainerData<TraitsT>::NeighborTable>();
  for (int d = 0; d <= TraitsT::kMaxDepth; ++d) {
    auto& records = (*table)[d];
    records.resize(tree.tileCount(d));
    forEachLiveTile(tree, d, [&](auto const& tile, auto const& accessor) {
      records[tile.index()] = haloOf<TraitsT>(tile, accessor).neighbors;
    });
  }
  return table;
}

template <class TraitsT>
std::shared_ptr<typename ContainerData<TraitsT>::HaloTable const>
computeTileHalos(Container<TraitsT> const& tree) {
  auto table = std::make_shared<typename ContainerData<TraitsT>::HaloTable>();
  for (int d = 0; d <= TraitsT::kMaxDepth; ++d) {
    auto& records = (*table)[d];
    records.resize(tree.tileCount(d));
    forEachLiveTile(tree, d, [&](auto const& tile, auto const& accessor) {
      records[tile.index()] = haloOf<TraitsT>(tile, accessor);
    });
  }
  return table;
}

template <class TraitsT>
std::shared_ptr<CompressedHaloTable<TraitsT> const>
computeCompressedTileHalos(Container<TraitsT> const& tree) {
  constexpr std::int64_t kChunk = 1024; // tiles whose records share one block of bytes
  auto table = std::make_shared<CompressedHaloTable<TraitsT>>();
  HaloCompression const compression;
  for (int d = 0; d <= TraitsT::kMaxDepth; ++d) {
    auto& records = table->records[d];
    std::int64_t const count = tree.tileCount(d);
    records.resize(count);
    std::size_t const firstBlock = table->storage.size();
    table->storage.resize(firstBlock + static_cast<std::size_t>(chunkCount(0, count, kChunk)));
    parallelChunks(0, count, kChunk, [&](std::int64_t chunk, std::int64_t begin, std::int64_t end) {
      auto accessor = tree.tileAccessor();
      auto& block = table->storage[firstBlock + static_cast<std::size_t>(chunk)];
      std::vector<std::size_t> starts;
      for (std::int64_t n = begin; n < end; ++n) {
        starts.push_back(block.size());
        auto const& tile = tree.tile(n, d);
        // A dead tile has an empty record.
        auto const bytes = tile.valid()
                               ? packHalo<TraitsT>(tile, haloOf<TraitsT>(tile, accessor), compression)
                               : std::vector<std::uint8_t>{0, 0};
        block.insert(block.end(), bytes.begin(), bytes.end());
      }
      starts.push_back(block.size());
      for (std::int64_t n = begin; n < end; ++n) {
        auto const at = static_cast<std::size_t>(n - begin);
        records[n] = {block.data() + starts[at], static_cast<std::uint32_t>(starts[at + 1] - starts[at])};
      }
    });
  }
  return table;
}

template <class TraitsT> int maxTileDistance(Container<TraitsT> const& tree) {
  if (tree.tileCount(-1) == 0) return 0;
  double largest = 0;
  for (int d = 0; d <= TraitsT::kMaxDepth; ++d) {
    bbox<int3, int> box;
    tree.tileSpaceBounds(d, box);
    double const x = extent(box, 0), y = extent(box, 1), z = extent(box, 2);
    largest = std::max(largest, std::ceil(std::sqrt(x * x + y * y + z * z) / TraitsT::width(d)));
  }
  return static_cast<int>(largest);
}

#define VLN_INSTANTIATE(T)                                                                                   \
  template float haloWeight<T>(Tile<T, T::kTileSize> const&, int, int);                                      \
  template void buildAccelerationGrid(Container<T> const&, ContainerData<T>&, int);                          \
  template std::shared_ptr<TileLookupTable<T> const> buildLookupTable(Container<T> const&);                  \
  template std::shared_ptr<typename ContainerData<T>::NeighborTable const> computeTileNeighbors(             \
      Container<T> const&);                                                                                  \
  template std::shared_ptr<typename ContainerData<T>::HaloTable const> computeTileHalos(                     \
      Container<T> const&);                                                                                  \
  template std::shared_ptr<CompressedHaloTable<T> const> computeCompressedTileHalos(Container<T> const&);    \
  template int maxTileDistance(Container<T> const&);
VLN_FOR_EACH_SHAPE(VLN_INSTANTIATE)

} // namespace VLN::TileTree3D
