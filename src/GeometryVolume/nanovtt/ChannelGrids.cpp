#include "GeometryVolume/nanovtt/ChannelGridsImpl.h"

#include "GeometryVolume/nanovtt/ChecksumImpl.h"

#include <algorithm>
#include <cfloat>
#include <cstring>

namespace nanovtt::Internal {

namespace {

constexpr char const* kFogName = "voxel_fog_density";

GridType storedType(GridType type, Build build) {
  if (type != GridType::kFloat) return type;
  switch (build) {
  case Build::kFp4:
    return GridType::kFp4;
  case Build::kFp8:
    return GridType::kFp8;
  case Build::kFp16:
    return GridType::kFp16;
  case Build::kFpN:
    return GridType::kFpN;
  case Build::kPlain:
    break;
  }
  return type;
}

} // namespace

// --- Sizes ---

void ChannelGrids::plan(VLN::Object const& object, VLN::Utils::ChannelParser const& filter) {
  auto const names = object.componentRange();
  for (GridElement const& element : gridElements())
    for (auto const& name : names) {
      if (!filter.accepts(name)) continue;
      if (auto channel = element.find(object, name)) add(element, name, std::move(channel));
    }
}

GridClass ChannelGrids::classOf(GridTask const& task, Ostil::String const& name) const {
  if (task.type != GridType::kFloat && !task.quantised()) return GridClass::kOther;
  Ostil::String const& n = name;
  bool const surface = n == "voxel_signed_distance" || n == "voxel_flame_level_set" || n == "surface";
  if (surface && *static_cast<float const*>(task.source.defaultValue) > 0) return GridClass::kLevelSet;
  return n == kFogName ? GridClass::kFogVolume : GridClass::kOther;
}

void ChannelGrids::add(GridElement const& element, Ostil::String const& name,
                       Ostil::Ptr<ChannelBase> channel) {
  Grid grid{&element, name, std::move(channel), std::make_unique<GridTask>(m_layout, m_settings)};
  GridTask& task = *grid.task;
  task.source = element.tiles(*grid.channel);
  task.setType(storedType(element.type, m_settings.build));
  task.gridClass = classOf(task, name);
  if (m_settings.fogFix && name == kFogName) task.fixFog = element.fixFog;
  if (task.quantised()) task.dither = makeDither(m_settings.dither);

  std::uint64_t const size = kGridHeaderBytes + dataSize(grid);
  task.size = padSection(size);
  m_totalSize += task.size;
  m_log.line("Grid #", m_grids.size(), ": Found channel of type '", element.name, "' and name '", name,
             "' and grid size ", task.size);
  m_grids.push_back(std::move(grid));
}

/// Bytes of tile table and tile data.
std::uint64_t ChannelGrids::dataSize(Grid& grid) {
  GridTask& task = *grid.task;
  if (m_settings.textures) {
    task.bricksAcross = cubeRootUp(m_layout.haloTileCount() + 1);
    m_log.line("texture dim = ", task.bricksAcross * kHaloTileWidth, " for property ", grid.name);
  }
  if (task.type == GridType::kFpN) {
    if (m_tolerance < 0) {
      m_tolerance = task.isLevelSet()                         ? 0.1f * m_layout.tree().voxelSize()
                    : task.gridClass == GridClass::kFogVolume ? 0.01f
                                                              : 0.0f;
    }
    task.tolerance = m_tolerance;
    m_log.line("tolerance = ", m_tolerance);
    planFpNTiles(task);
  } else if (task.quantised()) {
    m_log.line("treeSize (quantization) = ", task.end());
  }
  return task.end();
}

// --- Contents ---

void ChannelGrids::clearGaps(std::uint8_t* buffer) const {
  std::uint64_t offset = m_layout.size();
  for (Grid const& grid : m_grids) {
    std::uint64_t const end = kTileTableOffset + grid.task->end();
    std::memset(buffer + offset, 0, kTileTableOffset);
    std::memset(buffer + offset + end, 0, grid.task->size - end);
    offset += grid.task->size;
  }
}

void ChannelGrids::write(std::uint8_t* buffer, Velorn::Math::bbox<Velorn::Math::float3, float>* outBox) {
  std::uint64_t offset = m_layout.size();
  for (std::uint64_t n = 0; n < m_grids.size(); ++n) {
    write(m_grids[n], n, buffer, offset, outBox);
    offset += m_grids[n].task->size;
  }
}

void ChannelGrids::write(Grid& grid, std::uint64_t index, std::uint8_t* buffer, std::uint64_t offset,
                         Velorn::Math::bbox<Velorn::Math::float3, float>* outBox) {
  GridTask& task = *grid.task;
  Ostil::String const& name = grid.name;
  task.bytes = buffer + offset;
  Stopwatch watch;
  m_log.line("Channel ", name, " stats:");
  m_log.line(" - minDepth = ", grid.channel->minDepth());
  m_log.line(" - maxDepth = ", grid.channel->depth());
  if (m_settings.coarserLevels) {
    setCoarserLevels(grid);
    m_log.stage(watch, name, ": Setting coarser levels = ");
  }
  writeHeader(grid, index, offset);
  m_log.line("name = '", name, "'");
  m_log.line("containerOffset = ", offset + kTreeOffset);
  m_log.line("Size of tile data = ", task.end() - task.tableBytes());
  if (m_layout.hasDeadTiles()) writeTable(task);
  if (task.bricksAcross > 0) {
    // What a texture read takes that finds no tile.
    std::uint64_t const size = elementBytes(task.type), width = task.bricksAcross * kHaloTileWidth;
    for (std::uint64_t k = 0; k < kHaloTileWidth; ++k)
      for (std::uint64_t j = 0; j < kHaloTileWidth; ++j)
        for (std::uint64_t i = 0; i < kHaloTileWidth; ++i)
          std::memcpy(task.table() + task.tableBytes() + ((k * width + j) * width + i) * size,
                      task.source.defaultValue, size);
  }
  ActiveBoxes const boxes = grid.element->fill(task);
  m_log.stage(watch, name, ": Adding data to tiles and computing bbox = ");
  store<std::uint64_t>(task.table() + 8 * std::uint64_t(m_layout.tileCount()), task.end());
  writeBoxes(grid, boxes, outBox);
  store<std::uint64_t>(task.bytes + kGridChecksumOffset, checksum(task, buffer));
  m_log.line("Adding gridAndTreeSize ", task.size);
  m_log.line("GridVTTBase = ", offset);
  m_log.line("GridCount = ", m_grids.size());
  m_log.line("GridIndex = ", index);
  m_log.line("GridSize = ", task.size);
  task.records = {}, task.offsets = {};
  watch.lap();
  grid.channel = nullptr;
  m_log.stage(watch, name, ": Setting to nullptr (potential dealloc) = ");
}

void ChannelGrids::setCoarserLevels(Grid& grid) {
  Tree const& tree = m_layout.tree();
  bool const differ = grid.element->coarserDiffer(*grid.channel, tree, m_offsetType,
                                                  m_settings.coarserTolerance, m_layout.rootDepth());
  m_log.line("areCoarserOK = ", !differ);
  if (!differ) return;
  grid.channel = grid.element->withCoarser(*grid.channel, tree, m_offsetType, m_layout.rootDepth());
  grid.task->source = grid.element->tiles(*grid.channel);
}

void ChannelGrids::writeHeader(Grid const& grid, std::uint64_t index, std::uint64_t offset) const {
  GridTask const& task = *grid.task;
  std::uint8_t* const bytes = task.bytes;
  store<std::uint64_t>(bytes + kGridMagicOffset, kGridMagic);
  store<std::uint32_t>(bytes + kGridVersionOffset, kGridVersion);
  store<std::uint32_t>(bytes + kGridFlagsOffset, 0);
  store<std::uint32_t>(bytes + kGridIndexOffset, static_cast<std::uint32_t>(index));
  store<std::uint32_t>(bytes + kGridCountOffset, static_cast<std::uint32_t>(m_grids.size()));
  store<std::uint64_t>(bytes + kGridSizeOffset, task.size);
  Ostil::String const& name = grid.name;
  std::memcpy(bytes + kGridNameOffset, name.data(), std::min<std::size_t>(name.size(), kGridNameBytes - 1));

  float const voxelSize = m_layout.tree().voxelSize();
  double const size = voxelSize;
  for (std::uint64_t a = 0; a < 3; ++a) {
    std::uint64_t const at = 4 * a; // of the diagonal
    store<float>(bytes + kMapMatrixFOffset + 4 * at, voxelSize);
    store<float>(bytes + kMapInverseFOffset + 4 * at, static_cast<float>(1.0 / size));
    store<double>(bytes + kMapMatrixDOffset + 8 * at, size);
    store<double>(bytes + kMapInverseDOffset + 8 * at, 1.0 / size);
    store<double>(bytes + kGridVoxelSizeOffset + 8 * a, size);
  }
  store<float>(bytes + kMapTaperFOffset, 1.0f);
  store<double>(bytes + kMapTaperDOffset, 1.0);
  store<std::uint32_t>(bytes + kGridClassOffset, static_cast<std::uint32_t>(task.gridClass));
  store<std::uint32_t>(bytes + kGridTypeOffset, static_cast<std::uint32_t>(task.type));
  store<std::uint64_t>(bytes + kTreeContainerOffset, offset + kTreeOffset);
  store<std::uint64_t>(bytes + kTreeSizeOffset, task.size - kTreeOffset);
  std::memcpy(bytes + kTreeDefaultOffset, task.source.defaultValue, elementBytes(task.type));
}

/// For the numbers of dead tiles, which nobody visits. The entries of the others are written again.
void ChannelGrids::writeTable(GridTask const& task) const {
  for (std::uint32_t n = 0; n < m_layout.tileCount(); ++n) {
    std::uint64_t const offset = task.offset(n);
    store(task.table() + 8 * std::uint64_t(n), task.entry(n, offset, m_layout.hasHalo(n), 0));
    if (task.type == GridType::kFpN) store(task.table() + offset, task.records[n]);
  }
}

void ChannelGrids::writeBoxes(Grid const& grid, ActiveBoxes const& boxes,
                              Velorn::Math::bbox<Velorn::Math::float3, float>* outBox) const {
  std::uint8_t* const bytes = grid.task->bytes;
  double const voxelSize = m_layout.tree().voxelSize();
  ActiveBox const& box = boxes.all;
  double low[3] = {DBL_MAX, DBL_MAX, DBL_MAX}, high[3] = {-DBL_MAX, -DBL_MAX, -DBL_MAX};
  for (std::uint64_t a = 0; a < 3; ++a) {
    store<std::int32_t>(bytes + kTreeBBoxOffset + 4 * a, box.low[a]);
    store<std::int32_t>(bytes + kTreeBBoxOffset + 12 + 4 * a, box.high[a]);
    if (!box.empty()) low[a] = box.low[a] * voxelSize, high[a] = box.high[a] * voxelSize;
    store<double>(bytes + kGridWorldBBoxOffset + 8 * a, low[a]);
    store<double>(bytes + kGridWorldBBoxOffset + 24 + 8 * a, high[a]);
  }
  ActiveBox const& visible = boxes.aboveThreshold;
  if (outBox && !visible.empty()) {
    auto const scaled = [&](int const c[3]) {
      return Velorn::Math::float3{static_cast<float>(c[0] * voxelSize), static_cast<float>(c[1] * voxelSize),
                                  static_cast<float>(c[2] * voxelSize)};
    };
    outBox->min = scaled(visible.low), outBox->max = scaled(visible.high);
  }
  m_log.line("WorldBBox = (", low[0], ", ", low[1], ", ", low[2], ") to (", high[0], ", ", high[1], ", ",
             high[2], ")");
}

/// The container's sum is part of each grid's: it proves that the two belong together.
std::uint64_t ChannelGrids::checksum(GridTask const& task, std::uint8_t const* buffer) {
  constexpr std::uint64_t kNone = 0, kFull = 2;
  if (m_settings.checksumMode == kNone) return kEmptyChecksum;
  if (!m_containerSumKnown) m_containerSum = crc32(buffer, m_layout.size()), m_containerSumKnown = true;
  std::uint8_t pair[8];
  store<std::uint32_t>(pair, m_containerSum);
  store<std::uint32_t>(pair + 4,
                       crc32(task.bytes + kGridVersionOffset, kTileTableOffset - kGridVersionOffset));
  std::uint64_t const head = crc32(pair, sizeof pair);
  std::uint64_t tail = 0xFFFFFFFFu;
  if (m_settings.checksumMode == kFull && m_layout.tileCount() > 0)
    tail = crc32(task.bytes + kTileTableOffset, task.size - kTileTableOffset);
  return tail << 32 | head;
}

} // namespace nanovtt::Internal
