// GridSource: a grid of any supported type, as the importer sees it.
#pragma once

#include "GeometryVolume/core/FunctionRef.h"
#include "GeometryVolume/tiletree/Morton.h"
#include "Interop/VdbBlocksImpl.h"
#include "Interop/VdbImport.h"
#include "Interop/VdbPackedLeavesImpl.h"
#include "Interop/VdbRecord.h"
#include "Interop/VdbTreeImpl.h"

#include <array>
#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace VLN::Interop {

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

/// The roots of a depth: their corners, and which of the places round them hold one. They are few on each
/// axis.
class RootPlaces {
public:
  RootPlaces(std::vector<Velorn::Math::int3> const& corners, int depth);

  std::vector<Velorn::Math::int3> const& corners() const { return m_corners; }
  int depth() const { return m_depth; }
  /// The places without a root among the seven at a root's high sides. The place one further along the axes
  /// whose bits are set in `side` has bit 1 << side; x has bit 1.
  unsigned missingBeside(Velorn::Math::int3 const& root) const {
    char const* const held = m_held.data() + numberOf(root);
    unsigned missing = 0;
    for (unsigned side = 1; side < 8; ++side) missing |= unsigned(!held[m_step[side]]) << side;
    return missing;
  }

private:
  std::int64_t numberOf(Velorn::Math::int3 const& corner) const {
    auto const place = [&](std::size_t a, int c) { return (std::int64_t(c) >> m_shift) - m_first[a]; };
    return (place(0, corner.x) * m_count[1] + place(1, corner.y)) * m_count[2] + place(2, corner.z);
  }

  std::vector<Velorn::Math::int3> m_corners;
  int m_depth;
  int m_shift; ///< their width is a power of two
  std::array<std::int64_t, 3> m_first{}, m_count{};
  std::array<std::int64_t, 8> m_step{}; ///< to the place beside
  std::vector<char> m_held;
};

/// Corners of tiles by depth.
using TileCorners = VLN::PerDepth<std::vector<Velorn::Math::int3>, VdbTraits::kDepths>;

/// What a grid needs of a tree.
struct NeededTiles {
  BlockList blocks;    ///< narrow tiles, and the places of leaves
  TileCorners wider;   ///< without the tiles that are as wide as leaves
  std::uint64_t count; ///< of narrow tiles, with some counted twice: of those that were asked for
};

/// Reports tiles as they are filled.
using FilledTiles = FunctionRef<void(std::int64_t tiles)>;

/// The tree that channels are made on.
struct TreeToFill {
  VdbContainer const& container;
  VdbTopology const& topology;
  bool followsLeaves; ///< see tilesFollowLeaves()
};

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
  /// Collects the tiles that the grid needs, without their ancestors: see VdbImport.h.
  /// @param mostTiles The shells of the widest tiles are left out where they would take more.
  virtual NeededTiles collectTiles(int rootDepth, std::uint64_t mostTiles) const = 0;
  /// Appends the corners of further roots: those on the high sides of the others where a blend would
  /// otherwise not meet the background.
  virtual void collectBeyondRoots(RootPlaces const& roots, std::vector<Velorn::Math::int3>& out) const = 0;
  /// The rule by which values tell what is active, or kChannel.
  virtual VdbActiveRule activeRule() const = 0;
  /// Voxels that are active although the rule says that they are not.
  virtual std::vector<Velorn::Math::int3> const& alsoActive() const = 0;
  /// A channel with the grid's values for every sample of the tree. Voxels that lie in packed leaves are gone
  /// afterwards.
  virtual Ostil::Ptr<TileTree3D::ChannelBase> makeChannel(std::string const& name, TreeToFill const& tree,
                                                          FilledTiles filled) const = 0;
  virtual Ostil::Ptr<StateChannel> makeStateChannel(std::string const& name,
                                                    TreeToFill const& tree) const = 0;
};

/// A grid, and where its voxels lie unless its leaves have them.
struct GridToRead {
  openvdb::GridBase::Ptr grid; ///< whose leaves will be numbered
  std::shared_ptr<PackedLeaves> packed;
};

/// Null for a type that is not supported; `type` then tells its name.
std::unique_ptr<GridSource> makeGridSource(GridToRead const& from, std::string& type);

// Its two halves, compiled apart.
std::unique_ptr<GridSource> makeScalarSource(GridToRead const& from);
std::unique_ptr<GridSource> makeVectorSource(GridToRead const& from);

/// The deepest depth at which all roots for grids with these summaries may lie.
int rootDepth(std::vector<GridSummary> const& grids);
/// That depth or a shallower one, whichever takes fewer tiles: deep roots are many where they have to cover
/// wide tiles, shallow ones stand above more ancestors.
int cheapestRootDepth(std::vector<Velorn::Math::int3> leaves, std::vector<Velorn::Math::int3> tiles,
                      int deepest);
/// Adds corners to others that are along the Z-shaped curve, and drops duplicates.
void addSorted(std::vector<Velorn::Math::int3>& corners, std::vector<Velorn::Math::int3> others);
/// Whether the tiles of each depth lie in the order of leaves, the deepest ones by the leaves that they are
/// in.
bool tilesFollowLeaves(VdbContainer const& container);
/// Joins extents and counts; neither has a range yet.
GridSummary joinSummaries(GridSummary a, GridSummary const& b);
/// Adds each tile's parents down from `rootDepth`, sorts each depth along the Z-shaped curve and drops
/// duplicates.
void completeCorners(TileCorners& corners, int rootDepth);

} // namespace VLN::Interop
