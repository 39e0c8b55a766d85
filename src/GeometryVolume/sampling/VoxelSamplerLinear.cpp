#include "GeometryVolume/sampling/VoxelSamplerLinear.h"

#include "GeometryVolume/channels/HaloRegionsImpl.h"
#include "GeometryVolume/channels/SharedReadTablesImpl.h"
#include "GeometryVolume/sampling/WidenedTilesImpl.h"

namespace VLN::TileTree3D {

int const kCacheSizeCoarserLevels = 1;

namespace {
/// Cells of ancestors that are read for one cell at most, and cells with gaps for which a tile is read in
/// place: beyond them its widened form is the shorter way.
constexpr int kMostParentCells = 12;
constexpr std::uint32_t kGapsWorthWidening = 8;
/// Reads of other tiles than before for which tables are worth their while: some, and one for so many tiles.
constexpr std::int64_t kFewTileChanges = 4096, kTilesPerChange = 8;
} // namespace

VLN_SAMPLER_TEMPLATE VLN_SAMPLER::VoxelSamplerLinear() { forgetTiles(); }
VLN_SAMPLER_TEMPLATE VLN_SAMPLER::~VoxelSamplerLinear() = default;

VLN_SAMPLER_TEMPLATE VLN_SAMPLER::VoxelSamplerLinear(ContainerT const& container, Topology const& topology,
                                                     WideChannel const& channel)
    : Base(container, topology)
    , m_tileAccessor(container.tileAccessor())
    , m_offsetTypeLinear(topology.offsetType())
    , m_container(&container)
    , m_topology(&topology)
    , m_invVoxelSize(1.0f / container.voxelSize()) {
  bind(nullptr, &channel);
}

VLN_SAMPLER_TEMPLATE VLN_SAMPLER::VoxelSamplerLinear(ContainerT const& container, Topology const& topology,
                                                     CoreChannel const& channel)
    : Base(container, topology)
    , m_tileAccessor(container.tileAccessor())
    , m_offsetTypeLinear(topology.offsetType())
    , m_cacheOneSided(TraitsT::kDepths)
    , m_cacheTwoSided(TraitsT::kDepths)
    , m_container(&container)
    , m_topology(&topology)
    , m_invVoxelSize(1.0f / container.voxelSize()) {
  bind(&channel, nullptr);
}

VLN_SAMPLER_TEMPLATE VLN_SAMPLER::VoxelSamplerLinear(VoxelSamplerLinear const& other)
    : Base(other) {
  *this = other;
}

VLN_SAMPLER_TEMPLATE auto VLN_SAMPLER::operator=(VoxelSamplerLinear const& other) -> VoxelSamplerLinear& {
  if (this == &other) return *this;
  Base::operator=(other);
  m_tileAccessor = other.m_tileAccessor;
  m_offsetTypeLinear = other.m_offsetTypeLinear;
  m_cacheOneSided = Cache<OneSidedTile>(other.m_cacheOneSided.size());
  m_cacheTwoSided = Cache<TwoSidedTile>(other.m_cacheTwoSided.size());
  m_container = other.m_container;
  m_channelCore = other.m_channelCore;
  m_channelWide = other.m_channelWide;
  m_topology = other.m_topology;
  m_invVoxelSize = other.m_invVoxelSize;
  m_defaultValue = other.m_defaultValue;
  m_minDepth = other.m_minDepth;
  m_maxDepth = other.m_maxDepth;
  m_shared = other.m_shared;
  m_arrays = other.m_arrays;
  forgetTiles();
  return *this;
}

VLN_SAMPLER_TEMPLATE char const* VLN_SAMPLER::idString() const { return "kLinear"; }

VLN_SAMPLER_TEMPLATE void VLN_SAMPLER::bind(CoreChannel const* core, WideChannel const* wide) {
  m_channelCore = core, m_channelWide = wide;
  auto const take = [this](auto const& channel) {
    m_defaultValue = channel.defaultValue();
    m_minDepth = channel.minDepth();
    m_maxDepth = std::min(channel.depth(), TraitsT::kMaxDepth);
  };
  if (core)
    take(*core);
  else
    take(*wide);
  if (m_maxDepth == TraitsT::kMaxDepth) m_shared = Ostil::makePtr<Internal::SharedReadTables<TraitsT>>();
  m_arrays = tileArrays();
  forgetTiles();
}

VLN_SAMPLER_TEMPLATE void VLN_SAMPLER::forgetTiles() {
  m_accessCount = 0;
  m_lastTile.fill(-1);
  m_lastSlot.fill(-1);
  m_highSides.fill({});
  m_blocks = m_blocksBeside = {};
  m_tileBefore = -1, m_tileChanges = 0;
  m_region = {};
  m_edge = {};
  m_finestBefore = nullptr;
}

// Calls f with the corners of a position's cell and 1 / width of its tile's voxels.
// @param p In tile space.
// @param isAbove Whether the tables are known to have no tile there.
// @return The default value where there is no tile.
VLN_SAMPLER_TEMPLATE template <class F>
[[gnu::always_inline]] inline float VLN_SAMPLER::withCorners(Internal::FloatLanes p, int depth, bool isAbove,
                                                             F const& f) const {
  using namespace Internal;
  if (depth > m_maxDepth) depth = m_maxDepth;
  TileSamples samples;
  bool isKnown = tileArrays() == m_arrays;
  if (m_region.holds(p, depth) && isKnown)
    samples = m_region.samples();
  else
    isKnown =
        isKnown && !isAbove && depth == TraitsT::kMaxDepth && m_blocks.isOpen() && findFinest(p, samples);
  return isKnown ? withCornersIn(samples, p, depth, f) : withCornersFound(p, depth, f);
}
// The same where the tile is known.
VLN_SAMPLER_TEMPLATE template <class F>
[[gnu::always_inline]] inline float VLN_SAMPLER::withCornersIn(Internal::TileSamples const& samples,
                                                               Internal::FloatLanes p, int depth,
                                                               F const& f) const {
  using namespace Internal;
  SampleCell cell;
  placeInCell<D>(p, __builtin_convertvector(samples.corner, FloatLanes), samples.scale.samples,
                 lanesOf(this->m_offset), cell);
  if (m_channelWide) return f(wideCorners(samples.data, cell), samples.scale.invVoxelWidth);
  if (isInside(cell)) {
    ++m_accessCount;
    return f(insideCorners(samples.data, cell), samples.scale.invVoxelWidth);
  }
  if (m_edge.is(samples.data, cell.ijk) || finestEdge(samples, cell)) {
    ++m_accessCount;
    return f({m_edge.low, m_edge.width, cell.weights}, samples.scale.invVoxelWidth);
  }
  return withCornersFound(p, depth, f);
}
// The same by a search.
VLN_SAMPLER_TEMPLATE template <class F>
[[gnu::always_inline]] inline float VLN_SAMPLER::withCornersFound(Internal::FloatLanes p, int depth,
                                                                  F const& f) const {
  SampleCell cell;
  CellCorners corners;
  return findCorners(p, depth, cell, corners) ? f(corners, cell.invVoxelWidth) : m_defaultValue;
}

VLN_SAMPLER_TEMPLATE float VLN_SAMPLER::sample(Position const& position, int depth,
                                               SamplerSpace space) const {
  return withCorners(this->toTileSpace(position, space), depth, false,
                     [](CellCorners const& corners, float) { return corners.value(); });
}
VLN_SAMPLER_TEMPLATE float VLN_SAMPLER::sampleGradient(Position const& position, int depth,
                                                       SamplerSpace space, Position* gradient) const {
  Position slope{0.0f, 0.0f, 0.0f}; // apart: the position may be where the gradient is to be
  float const value = withCorners(this->toTileSpace(position, space), depth, false,
                                  [&](CellCorners const& corners, float inverse) {
                                    slope = corners.slope() * (inverse * 2.0f * m_invVoxelSize);
                                    return corners.value();
                                  });
  *gradient = slope;
  return value;
}

// The corners of a position's cell by a search.
// @return false where the position takes the default value.
VLN_SAMPLER_TEMPLATE [[gnu::noinline]] bool
VLN_SAMPLER::findCorners(Internal::FloatLanes p, int depth, SampleCell& cell, CellCorners& corners) const {
  if (!this->locate(p, Internal::floorLanesAnywhere(p), depth, cell) || !covers(cell.tile)) return false;
  bool const isOther = cell.tile.index != m_tileBefore;
  if (isOther) countTile(cell.tile.index);
  // Of the smallest tiles the second time: what is read at random needs no region.
  if (!(isOther && cell.tile.depth == TraitsT::kMaxDepth) && tileArrays() == m_arrays) {
    auto const& last = this->m_last;
    m_region.set(last.regionCorner(), last.regionWidth(), depth,
                 {dataOf(cell.tile), last.corner(), Internal::kSampleScales<TraitsT>[cell.tile.depth]});
  }
  corners = cornersOf(cell);
  return true;
}

VLN_SAMPLER_TEMPLATE auto VLN_SAMPLER::cornersOf(SampleCell const& cell) const -> CellCorners {
  float const* const data = dataOf(cell.tile);
  if (m_channelWide) return wideCorners(data, cell);
  ++m_accessCount;
  if (isInside(cell)) return insideCorners(data, cell);
  m_edge.tile = nullptr; // memory may end while what it refers to is overwritten
  auto const corners = cachedCorners(cell.tile, Internal::toInt3(cell.ijk), Internal::toFloat3(cell.weights));
  m_edge = {data, cell.ijk, corners.low, corners.width};
  return corners;
}
VLN_SAMPLER_TEMPLATE float VLN_SAMPLER::sample(TreeIndex const& tile, int3 const& ijk,
                                               Position const& weights) const {
  if (tile.depth > m_maxDepth) return sampleAbove(tile, ijk, weights);
  if (!covers(tile)) return m_defaultValue;
  return cornersOf({tile, 0.0f, Internal::lanesOf(ijk), Internal::lanesOf(weights)}).value();
}

// The tile of the deepest depth that holds the position, by the tables.
// @return false where there is none.
VLN_SAMPLER_TEMPLATE [[gnu::always_inline]] inline bool
VLN_SAMPLER::findFinest(Internal::FloatLanes p, Internal::TileSamples& samples) const {
  using namespace Internal;
  constexpr int kDepth = TraitsT::kMaxDepth;
  auto const c = floorLanesAnywhere(p);
  FinestSample const at = m_blocks.find(c[0], c[1], c[2]);
  if (!at.elements) return false;
  IntLanes const corner = c - IntLanes{int(at.i), int(at.j), int(at.k), 0};
  samples = {static_cast<float const*>(at.elements), corner, kSampleScales<TraitsT>[kDepth]};
  // The second position in a tile: it may well be a walk.
  if (samples.data == m_finestBefore) m_region.set(corner, TraitsT::width(kDepth), kDepth, samples);
  m_finestBefore = samples.data;
  return true;
}

VLN_SAMPLER_TEMPLATE auto VLN_SAMPLER::findTile(int i, int j, int k, int depth) const -> CoreTile {
  TreeIndex const at = m_tileAccessor.treeIndex(i, j, k, depth, true);
  if (!at.valid() || depth < m_minDepth || depth > m_maxDepth ||
      at.index >= m_channelCore->tileCount(at.depth))
    return {};
  return m_channelCore->tileData(at);
}

VLN_SAMPLER_TEMPLATE float VLN_SAMPLER::sampleAbove(TreeIndex const& tile, int3 const& ijk,
                                                    Position const& weights) const {
  if (tile.index < 0 || tile.depth > TraitsT::kMaxDepth || tile.index >= m_container->tileCount(tile.depth))
    return m_defaultValue;
  auto const& there = m_container->tile(tile.index, tile.depth);
  float const width = static_cast<float>(there.tileVoxelWidth()) / static_cast<float>(D);
  Position p{};
  for (int a = 0; a < 3; ++a)
    p[a] = static_cast<float>(there.tijk()[a]) +
           (static_cast<float>(ijk[a]) + weights[a] + this->m_offset[a]) * width;
  return sample(p, m_maxDepth, kSamplerTileSpace);
}

VLN_SAMPLER_TEMPLATE auto VLN_SAMPLER::cachedCorners(TreeIndex const& tile, int3 const& ijk,
                                                     Position const& weights) const -> CellCorners {
  auto const entry = [&](auto& cache) -> auto& {
    if (m_lastTile[tile.depth] == tile.index) return cache[m_lastSlot[tile.depth]];
    return updateCache(tile.index, tile.depth, cache);
  };
  if (this->m_offsetType == kVoxelOffsetCorner) {
    // A tile that is asked for gaps again and again is worth widening.
    int budget = kMostParentCells;
    if (m_lastTile[tile.depth] != tile.index &&
        (m_highSides[tile.depth].tile != tile.index || m_highSides[tile.depth].gaps < kGapsWorthWidening) &&
        edgeCorners(tile, ijk, m_corners.data(), budget))
      return {m_corners.data(), 2, Internal::lanesOf(weights)};
    constexpr int w = D + 1;
    float const* const data = entry(m_cacheOneSided).data.data()->data();
    return {data + ijk.x + w * (ijk.y + w * ijk.z), w, Internal::lanesOf(weights)};
  }
  constexpr int w = D + 2;
  float const* const data = entry(m_cacheTwoSided).data.data()->data();
  return {data + (ijk.x + 1) + w * ((ijk.y + 1) + w * (ijk.z + 1)), w, Internal::lanesOf(weights)};
}

// Opens the tables once they are there. Makes them when as many reads have gone to other tiles as take about
// the same time.
VLN_SAMPLER_TEMPLATE void VLN_SAMPLER::openTables(std::int64_t tileChanges) const {
  if (!m_shared || m_blocks.isOpen()) return;
  auto& shared = *m_shared;
  auto const* tables = shared.ready.load(std::memory_order_acquire);
  if (!tables) {
    std::int64_t const changes = shared.tileChanges.fetch_add(tileChanges) + tileChanges;
    std::int64_t const tiles = m_container->tileCount(TraitsT::kMaxDepth);
    if (changes < kFewTileChanges + tiles / kTilesPerChange || shared.begun.test_and_set()) return;
    try {
      shared.tables = std::make_unique<Internal::ReadTables<TraitsT>>(
          *m_container, [this](std::int64_t n) -> void const* {
            auto const size =
                static_cast<std::size_t>(m_channelWide ? WideChannel::kSize : CoreChannel::kSize);
            auto const& arrays = (*tileArrays())[TraitsT::kMaxDepth];
            return n < std::ssize(arrays) && arrays[n].size() >= size ? arrays[n].data() : nullptr;
          });
    } catch (std::exception const&) { return; } // no memory, or too many tiles: it goes without
    shared.ready.store(tables = shared.tables.get(), std::memory_order_release);
  }
  m_blocks = m_blocksBeside = Internal::BlockCursor<TraitsT>(*tables);
}

// A cell of corner samples on the edge of a tile of the deepest depth, by the tables.
// @return false of another tile, and where a tile beside it is needed and not there.
VLN_SAMPLER_TEMPLATE [[gnu::noinline]] bool VLN_SAMPLER::finestEdge(Internal::TileSamples const& samples,
                                                                    SampleCell const& cell) const {
  using namespace Internal;
  bool const isFinest =
      samples.scale.invVoxelWidth == kSampleScales<TraitsT>[TraitsT::kMaxDepth].invVoxelWidth;
  if (this->m_offsetType != kVoxelOffsetCorner || !isFinest || !m_blocks.isOpen()) return false;
  unsigned edge = 0;
  for (int a = 0; a < 3; ++a) edge |= unsigned(cell.ijk[a] == D - 1) << a;
  std::array<float const*, 8> tiles;
  tiles[0] = samples.data;
  for (unsigned direction = edge; direction; direction = (direction - 1) & edge) {
    auto const on = [&](unsigned bit) { return direction & bit ? D : 0; };
    auto const at =
        m_blocksBeside.find(samples.corner[0] + on(1), samples.corner[1] + on(2), samples.corner[2] + on(4));
    if (!at.elements) return false;
    tiles[direction] = static_cast<float const*>(at.elements);
  }
  readEdge(toInt3(cell.ijk), edge, tiles, m_corners.data());
  m_edge = {samples.data, cell.ijk, m_corners.data(), 2};
  return true;
}

// Goes through positions by portions, whose data it fetches first.
// @param f Called with the number of a position, the position, whether the tables were asked for its tile,
// and what they gave.
VLN_SAMPLER_TEMPLATE template <class F>
void VLN_SAMPLER::forBatches(Position const* positions, std::int64_t count, int depth, SamplerSpace space,
                             F const& f) const {
  using namespace Internal;
  constexpr std::size_t kPortion = 24;
  // So many reads pay for the tables if most of them go to other tiles.
  if (depth >= TraitsT::kMaxDepth) openTables(count / 8);
  int const w = m_channelWide ? D + 1 : D;
  std::array<FloatLanes, kPortion> p;
  std::array<IntLanes, kPortion> corners;
  std::array<typename ReadTables<TraitsT>::Block const*, kPortion> blocks;
  std::array<float const*, kPortion> tiles;
  for (std::int64_t begin = 0, end; begin < count; begin = end) {
    auto const n = static_cast<std::size_t>(std::min<std::int64_t>(kPortion, count - begin));
    for (std::size_t i = 0; i < n; ++i) p[i] = this->toTileSpace(positions[begin + std::int64_t(i)], space);
    bool const byTables = m_blocks.isOpen() && depth >= TraitsT::kMaxDepth && tileArrays() == m_arrays;
    // Ways through empty space stay in one region for long: there is nothing to fetch.
    std::size_t near = 0;
    while (near < n && (!byTables || m_region.holds(p[near], m_maxDepth))) {
      f(begin + std::int64_t(near), p[near], false, nullptr);
      ++near;
    }
    end = begin + std::int64_t(near > 0 ? near : n);
    if (near > 0) continue;
    auto cursor = m_blocks;
    for (std::size_t i = 0; i < n; ++i) {
      corners[i] = floorLanesAnywhere(p[i]);
      cursor.seek(corners[i][0], corners[i][1], corners[i][2]);
      blocks[i] = &cursor.block();
      __builtin_prefetch(blocks[i]);
    }
    m_blocks = cursor;
    for (std::size_t i = 0; i < n; ++i) {
      FinestSample const at =
          Internal::BlockCursor<TraitsT>::findIn(*blocks[i], corners[i][0], corners[i][1], corners[i][2]);
      tiles[i] = static_cast<float const*>(at.elements);
      if (!tiles[i]) continue;
      float const* const low = tiles[i] + (int(at.i) + w * (int(at.j) + w * int(at.k)));
      __builtin_prefetch(low);
      __builtin_prefetch(low + (w * w + w + 1));
      corners[i] -= IntLanes{int(at.i), int(at.j), int(at.k), 0};
    }
    for (std::size_t i = 0; i < n; ++i) {
      TileSamples const samples{tiles[i], corners[i], kSampleScales<TraitsT>[TraitsT::kMaxDepth]};
      f(begin + std::int64_t(i), p[i], true, tiles[i] ? &samples : nullptr);
    }
  }
}

VLN_SAMPLER_TEMPLATE void VLN_SAMPLER::sample(Position const* positions, float* values, std::int64_t count,
                                              int depth, SamplerSpace space) const {
  auto const value = [](CellCorners const& corners, float) { return corners.value(); };
  forBatches(
      positions, count, depth, space,
      [&](std::int64_t n, Internal::FloatLanes p, bool isLookedUp, Internal::TileSamples const* samples) {
        values[n] = samples ? withCornersIn(*samples, p, m_maxDepth, value)
                            : withCorners(p, depth, isLookedUp, value);
      });
}
VLN_SAMPLER_TEMPLATE void VLN_SAMPLER::sampleGradient(Position const* positions, float* values,
                                                      Position* gradients, std::int64_t count, int depth,
                                                      SamplerSpace space) const {
  forBatches(
      positions, count, depth, space,
      [&](std::int64_t n, Internal::FloatLanes p, bool isLookedUp, Internal::TileSamples const* samples) {
        Position slope{0.0f, 0.0f, 0.0f};
        auto const value = [&](CellCorners const& corners, float inverse) {
          slope = corners.slope() * (inverse * 2.0f * m_invVoxelSize);
          return corners.value();
        };
        values[n] = samples ? withCornersIn(*samples, p, m_maxDepth, value)
                            : withCorners(p, depth, isLookedUp, value);
        gradients[n] = slope;
      });
}

// Finds the tile of the same depth that lies on in a direction.
VLN_SAMPLER_TEMPLATE void VLN_SAMPLER::findHighSide(TreeIndex const& tile, HighSides& sides,
                                                    unsigned direction) const {
  if (sides.known >> direction & 1) return;
  static_assert(D * D * D <= 125); // see HighSides::set()
  int3 const corner =
      this->m_last.tile() == tile ? Internal::toInt3(this->m_last.corner()) : m_container->tile(tile).tijk();
  int const w = TraitsT::width(tile.depth);
  auto const on = [&](unsigned bit) { return direction & bit ? w : 0; };
  TreeIndex const at =
      m_tileAccessor.treeIndex(corner.x + on(1), corner.y + on(2), corner.z + on(4), tile.depth, true);
  sides.set(direction, at.valid() ? dataOf(at) : nullptr);
}

// The eight samples of a cell of corner samples, x fastest.
// @param edge Bits of the axes on which the cell begins at the tile's last sample.
// @param tiles The tile, and those on along x, y and z by bits.
VLN_SAMPLER_TEMPLATE void VLN_SAMPLER::readEdge(int3 const& low, unsigned edge,
                                                std::array<float const*, 8> const& tiles, float* corners) {
  auto const next = [edge](int i, unsigned bit) { return edge & bit ? 0 : i + 1; };
  int const x[2] = {low.x, next(low.x, 1)}, y[2] = {D * low.y, D * next(low.y, 2)},
            z[2] = {D * D * low.z, D * D * next(low.z, 4)};
  // Written out, without branches: which samples come from where is hard to foretell.
  auto const read = [&](unsigned c) { corners[c] = tiles[c & edge][x[c & 1] + (y[c >> 1 & 1] + z[c >> 2])]; };
  read(0), read(1), read(2), read(3), read(4), read(5), read(6), read(7);
}

// The eight samples of a cell of corner samples: those beyond the tile from the tiles beside it,
// and what these lack blended from the parent's cell. Just what the widened tile holds, without the rest of
// it.
// @return false where that takes more than `budget` cells of ancestors.
VLN_SAMPLER_TEMPLATE bool VLN_SAMPLER::edgeCorners(TreeIndex const& tile, int3 const& low, float* corners,
                                                   int& budget) const {
  auto& sides = m_highSides[tile.depth];
  if (sides.tile != tile.index) {
    sides.tile = tile.index, sides.known = sides.missing = sides.gaps = 0;
    sides.set(0, dataOf(tile));
  }
  unsigned const edge =
      unsigned(low.x == D - 1) | unsigned(low.y == D - 1) << 1 | unsigned(low.z == D - 1) << 2;
  // Bits of the directions that a cell asks for: the parts of its edge.
  static constexpr std::array<std::uint8_t, 8> kParts = {0x01, 0x03, 0x05, 0x0f, 0x11, 0x33, 0x55, 0xff};
  if (kParts[edge] & ~sides.known)
    for (unsigned direction = edge; direction; direction = (direction - 1) & edge)
      findHighSide(tile, sides, direction);
  readEdge(low, edge, sides.data, corners);
  if (!(kParts[edge] & sides.missing)) return true;

  unsigned gaps = 0;
  for (unsigned c = 0; c < 8; ++c) gaps |= (sides.missing >> (c & edge) & 1) << c;
  ++sides.gaps;
  auto const& record = m_container->tile(tile);
  if (!hasUsableParent(record)) {
    for (unsigned c = 0; c < 8; ++c) {
      auto const at = [&](int i, unsigned bit) { return std::min(c & bit ? i + 1 : i, D - 1); };
      if (gaps >> c & 1) corners[c] = sides.data[0][at(low.x, 1) + D * (at(low.y, 2) + D * at(low.z, 4))];
    }
    return true;
  }
  TreeIndex const parent = record.parentTreeIndex();
  int3 const child = m_container->tile(parent).childIJK(record);
  auto const& axes = Internal::kHaloTable<TraitsT, 0, 0, 1, 0>.parentAxis;
  int3 lowOfParent{-1, -1, -1};
  std::array<float, 8> cornersOfParent;
  for (unsigned c = 0; c < 8; ++c) {
    if (!(gaps >> c & 1)) continue;
    Internal::HaloAxis axis[3];
    for (int a = 0; a < 3; ++a) axis[a] = axes[child[a]][low[a] + int(c >> a & 1)];
    int3 const cell{axis[0].at, axis[1].at, axis[2].at};
    if (cell != lowOfParent) {
      if (budget-- == 0 || !edgeCorners(parent, cell, cornersOfParent.data(), budget)) return false;
      lowOfParent = cell;
    }
    corners[c] =
        CellCorners{cornersOfParent.data(), 2, {axis[0].fraction, axis[1].fraction, axis[2].fraction, 0.0f}}
            .value();
  }
  return true;
}

#define VLN_INSTANTIATE(TraitsT)                                                                             \
  template class VLN_API VoxelSamplerLinear<TraitsT, float, 1, float, float3, 0, 0>;
VLN_FOR_EACH_SHAPE(VLN_INSTANTIATE)

} // namespace VLN::TileTree3D
