// GridSource: a grid of any supported type, as the importer sees it.
#pragma once

#include "GeometryVolume/channels/Channel.h"
#include "GeometryVolume/core/FunctionRef.h"
#include "GeometryVolume/tiletree/Container.h"
#include "GeometryVolume/tiletree/Morton.h"
#include "GeometryVolume/topology/VoxelTopology.h"
#include "Interop/VdbImport.h"
#include "Interop/VdbRecord.h"

#include <openvdb/openvdb.h>

#include <array>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <vector>

namespace VLN::Interop {

using VdbTraits = TileTree3D::PowerOfTwoTraits;
using VdbContainer = TileTree3D::Container<VdbTraits>;
using VdbTopology = TileTree3D::VoxelTopology<VdbTraits>;
using StateChannel = TileTree3D::Channel<VdbTraits, unsigned char, 4, 0>;

/// Width of a node of the file's tree, of 8 (leaf), 128 and 4096 voxels, and what goes with it here.
inline constexpr int kNodeWidths[3] = {8, 128, 4096};

/// Depth of the tiles whose samples are `width` wide.
constexpr int depthOfSamples(int width) {
  int depth = VdbTraits::kMaxDepth;
  for (; width > 1; width /= 2) --depth;
  return depth;
}
/// Depth of the tiles that are `width` wide.
constexpr int depthOfTiles(int width) { return depthOfSamples(width / VdbTraits::kTDW); }
static_assert(depthOfSamples(8) == 25 && depthOfSamples(128) == 21 && depthOfSamples(4096) == 16);

/// What one grid holds, in the measures of the tree.
struct GridSummary {
  IndexBox stored; ///< leaves, active tiles, and tiles with another value than the background, whole
  int shallowest = VdbTraits::kMaxDepth; ///< depth that the widest such tile asks for
  IndexBox active;
  std::int64_t activeVoxels = 0;
  std::int64_t activeTiles = 0;
  double minimum = 0, maximum = 0; ///< of values, or of the lengths of vectors
  bool hasRange = false;
};

/// Corners of tiles by depth.
using TileCorners = std::array<std::vector<Velorn::Math::int3>, VdbTraits::kDepths>;

/// Reports tiles as they are filled.
using FilledTiles = FunctionRef<void(std::int64_t tiles)>;

class GridSource {
public:
  virtual ~GridSource() = default;
  virtual openvdb::GridBase const& grid() const = 0;
  /// As reports name the type: "float", "int32", "vec3s", ...
  virtual std::string type() const = 0;
  virtual std::size_t bytesPerSample() const = 0;

  /// Why the grid cannot be placed in the tree; nothing when it can.
  virtual std::optional<std::string> whyNotPlaced() const = 0;
  virtual GridSummary summarize() const = 0;
  /// Appends the corners of all leaves, and of the file's tiles with another value than the background.
  virtual void collectStored(std::vector<Velorn::Math::int3>& leaves,
                             std::vector<Velorn::Math::int3>& tiles) const = 0;
  /// Appends the corners of the tiles that the grid needs, without their ancestors: see VdbImport.h.
  /// @param mostTiles The shells of the widest tiles are left out where they would take more.
  virtual void collectTiles(int rootDepth, std::uint64_t mostTiles, TileCorners& corners) const = 0;
  /// Appends the corners of further roots: those on the high sides of the others where a blend would
  /// otherwise not meet the background.
  virtual void collectBeyondRoots(std::set<std::array<int, 3>> const& roots, int depth,
                                  std::vector<Velorn::Math::int3>& out) const = 0;
  /// The rule by which values tell what is active, or kChannel.
  virtual VdbActiveRule activeRule() const = 0;
  /// A channel with the grid's values for every sample of the tree.
  virtual Ostil::Ptr<TileTree3D::ChannelBase> makeChannel(std::string const& name,
                                                          VdbContainer const& container,
                                                          VdbTopology const& topology,
                                                          FilledTiles filled) const = 0;
  virtual Ostil::Ptr<StateChannel> makeStateChannel(std::string const& name, VdbContainer const& container,
                                                    VdbTopology const& topology) const = 0;
};

/// Null for a type that is not supported; `type` then tells its name.
std::unique_ptr<GridSource> makeGridSource(openvdb::GridBase::ConstPtr const& grid, std::string& type);

/// What export reads of one grid.
struct GridToWrite {
  VdbContainer const& container;
  TileTree3D::ChannelBase const& channel;
  StateChannel const* state; ///< null unless the rule is kChannel
  VdbActiveRule rule;
};

/// A grid with the values and the active states of a channel; null for an unsupported type name.
openvdb::GridBase::Ptr makeGrid(std::string const& type, GridToWrite const& from);

// The two halves of makeGridSource() and makeGrid(), compiled apart.
std::unique_ptr<GridSource> makeScalarSource(openvdb::GridBase::ConstPtr const& grid);
std::unique_ptr<GridSource> makeVectorSource(openvdb::GridBase::ConstPtr const& grid);
openvdb::GridBase::Ptr makeScalarGrid(std::string const& type, GridToWrite const& from);
openvdb::GridBase::Ptr makeVectorGrid(std::string const& type, GridToWrite const& from);

/// The deepest depth at which all roots for grids with these summaries may lie.
int rootDepth(std::vector<GridSummary> const& grids);
/// That depth or a shallower one, whichever takes fewer tiles: deep roots are many where they have to cover
/// wide tiles, shallow ones stand above more ancestors.
int cheapestRootDepth(std::vector<Velorn::Math::int3> leaves, std::vector<Velorn::Math::int3> tiles,
                      int deepest);
/// Brings into Morton order: corners whose first `known` and whose others are each so, and more.
void joinSorted(std::vector<Velorn::Math::int3>& corners, std::size_t known,
                std::vector<Velorn::Math::int3> others);
/// Joins extents and counts; neither has a range yet.
GridSummary joinSummaries(GridSummary a, GridSummary const& b);
/// Adds each tile's parents down from `rootDepth`, sorts each depth along the Z-shaped curve and drops
/// duplicates.
void completeCorners(TileCorners& corners, int rootDepth);

} // namespace VLN::Interop
