#include "GeometryVolume/nanovtt/ConversionImpl.h"

#include "GeometryVolume/nanovtt/ChannelGridsImpl.h"

#include <optional>

namespace nanovtt::Internal {

namespace {

struct Sizes {
  std::uint64_t container, grids, buffer;
};

void reportSizes(Log const& log, ContainerLayout const& layout, Sizes const& sizes) {
  if (!log) return;
  auto const percent = [&](std::uint64_t part) { return 100.0 * double(part) / double(sizes.buffer); };
  log.line("numNanoVTTTiles = ", layout.tileCount());
  log.line("bufferSize = ", sizes.buffer);
  log.line(" - Size of TileDataVariable = ", 12);
  log.line(" - Size of TreeIndex = ", 8);
  log.line(" - Size of VoxelCoord = ", 16);
  log.line(" - Size of TileIndex = ", 4);
  log.line(" - Size of nanovdb::Coord = ", 12);
  log.line(" - Traits::kTileSize = ", Traits::kTileSize);
  log.line("containerSize = ", sizes.container, " (", percent(sizes.container), "%)");
  log.line("gridAndTreeSizeTotal = ", sizes.grids, " (", percent(sizes.grids), "%)");
}

} // namespace

bool convert(VLN::Object const& object, Ostil::String const& filter, ConversionSettings const& settings,
             BufferMaker const& makeBuffer, Velorn::Math::bbox<Velorn::Math::float3, float>* outBox) {
  Log const log(settings.log);
  Stopwatch all, watch;
  auto const tree = object.component<Tree>("voxel_tile_tree");
  auto const topology = object.component<VLN::TileTree3D::VoxelTopology<Traits>>("voxel_component");
  if (!tree || !topology) {
    log.stage(watch, "Channels pass 2 = ");
    log.stage(all, "converted from VTT to NanoVTT in ");
    return false;
  }

  {
    ContainerLayout layout(*tree, settings);
    if (!layout.plan(object, makeBuffer)) return false;
    log.stage(watch, "Container pass 1 = ");

    std::optional<VLN::Utils::ChannelParser> parser(std::in_place);
    // A text that is no filter keeps what stands before its fault, and that is what selects.
    (void)parser->parses(filter);
    ChannelGrids grids(layout, settings, topology->offsetType());
    grids.plan(object, *parser);
    log.line("Found #", grids.count(), " number of grids");
    log.stage(watch, "Channels pass 1 = ");

    std::uint64_t const used = layout.size() + grids.totalSize();
    Sizes const sizes{layout.size(), grids.totalSize(), used - used % kSectionAlignment + kSectionAlignment};
    reportSizes(log, layout, sizes);
    std::uint64_t const size = settings.cubic ? cubicSize(sizes.buffer, settings.elementBytes)
                                              : blockSize(sizes.buffer, settings.elementBytes);
    std::uint8_t* const bytes = makeBuffer(BufferRole::kMain, size);
    if (grids.writesAllTiles()) {
      layout.clear(bytes);
      grids.clearGaps(bytes);
      fillZeros(bytes + used, size - used);
    } else {
      fillZeros(bytes, size);
    }
    log.stage(watch, "Allocation and clearing buffers = ");

    layout.write(bytes, size);
    log.stage(watch, "Container pass 2 = ");
    grids.write(bytes, outBox);
    log.stage(watch, "Channels pass 2 = ");
    parser.reset();
  }
  log.stage(all, "converted from VTT to NanoVTT in ");
  return true;
}

} // namespace nanovtt::Internal
