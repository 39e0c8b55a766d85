// ChannelGrids: the grids of a flat buffer, one for each channel that a filter lets through. Sized first,
// then filled in place.
#pragma once

#include "GeometryVolume/nanovtt/GridElementsImpl.h"
#include "GeometryVolume/topology/VoxelTopology.h"
#include "GeometryVolume/utils/ChannelParser.h"

#include <memory>

namespace nanovtt::Internal {

class ChannelGrids {
public:
  ChannelGrids(ContainerLayout const& layout, ConversionSettings const& settings,
               VLN::TileTree3D::VoxelOffsetType offsetType)
      : m_layout(layout)
      , m_settings(settings)
      , m_offsetType(offsetType)
      , m_log(settings.log)
      , m_tolerance(settings.tolerance) {}

  /// Finds the channels and sizes their grids.
  void plan(VLN::Object const& object, VLN::Utils::ChannelParser const& filter);
  /// Writes all grids.
  /// @param buffer The whole buffer: the container section is written, the grids' bytes are zero.
  /// @param outBox If given, takes the box of what lies above the fog's threshold, in world space, from each
  /// grid that has one.
  void write(std::uint8_t* buffer, Velorn::Math::bbox<Velorn::Math::float3, float>* outBox);

  std::uint64_t count() const { return m_grids.size(); }
  /// Bytes of all grids.
  std::uint64_t totalSize() const { return m_totalSize; }
  /// Whether every byte of every tile is going to be written, so that nobody needs to clear it before.
  bool writesAllTiles() const {
    return !m_settings.textures && !m_settings.coalesce && !m_layout.hasDeadTiles();
  }
  /// Clears what writing leaves out.
  /// @pre writesAllTiles().
  void clearGaps(std::uint8_t* buffer) const;

private:
  struct Grid {
    GridElement const* element;
    Ostil::String name;
    Ostil::Ptr<ChannelBase> channel;
    std::unique_ptr<GridTask> task;
  };

  void add(GridElement const& element, Ostil::String const& name, Ostil::Ptr<ChannelBase> channel);
  GridClass classOf(GridTask const& task, Ostil::String const& name) const;
  std::uint64_t dataSize(Grid& grid);
  void write(Grid& grid, std::uint64_t index, std::uint8_t* buffer, std::uint64_t offset,
             Velorn::Math::bbox<Velorn::Math::float3, float>* outBox);
  void setCoarserLevels(Grid& grid);
  void writeHeader(Grid const& grid, std::uint64_t index, std::uint64_t offset) const;
  void writeTable(GridTask const& task) const;
  void writeBoxes(Grid const& grid, ActiveBoxes const& boxes,
                  Velorn::Math::bbox<Velorn::Math::float3, float>* outBox) const;
  std::uint64_t checksum(GridTask const& task, std::uint8_t const* buffer);

  ContainerLayout const& m_layout;
  ConversionSettings const& m_settings;
  VLN::TileTree3D::VoxelOffsetType m_offsetType;
  Log m_log;
  float m_tolerance; ///< below 0 until the first float channel settles it
  std::vector<Grid> m_grids;
  std::uint64_t m_totalSize = 0;
  std::uint32_t m_containerSum = 0;
  bool m_containerSumKnown = false;
};

} // namespace nanovtt::Internal
