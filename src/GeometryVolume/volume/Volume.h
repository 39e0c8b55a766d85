// Volume: a tree with fields on it, made, grown and read in a few lines.
//
//   Volume volume;
//   auto density = volume.addField<float>("density", 0);
//   density.set(1, 2, 3, 0.5f);
//
// The parts are those of the other rooms, and stay reachable: tree(), topology(), Field::channel(), object().
// Whoever needs other shapes, layouts or sample offsets assembles them with Command.
#pragma once

#include "GeometryVolume/volume/Field.h"

#include <memory>
#include <span>
#include <string>
#include <type_traits>
#include <vector>

namespace VLN::TileTree3D {

/// A tile, as predicates see it.
struct TileBox {
  int3 corner; ///< in tile space
  int width;   ///< in samples of the deepest depth
  int depth;
};

/// Tiles of 4 x 4 x 4 samples, which lie on the low corners of their voxels.
///
/// What changes the tree, a field's set() foremost, leaves the other parts behind for a moment; each call
/// here and in Field brings into step what it shows. Copies share everything until one of them is written.
/// @threads Const calls may run at once. All others need the volume, and its fields, for themselves.
class VLN_API Volume {
public:
  using Shape = Internal::VolumeShape;
  using Tree = Internal::VolumeTree;
  using Topology = Internal::VolumeTopology;

  /// @param voxelSize World length of a sample of the deepest depth.
  explicit Volume(float voxelSize = 1.0f);
  /// Takes over an object with a tree and a voxel topology of this shape, such as an importer makes. Channels
  /// of the layout (4,0) that span all depths become fields; the rest comes along, and back with object().
  /// @error std::invalid_argument for an object without these.
  explicit Volume(VLN::Object const& object);
  /// @cost Constant for each field. The first write to either copies what it writes: a field whole.
  Volume(Volume const& other);
  Volume(Volume&& other) noexcept;
  Volume& operator=(Volume const& other);
  Volume& operator=(Volume&& other) noexcept;
  ~Volume();

  // Fields, by name. T is one of the 18 element types.
  /// @error std::invalid_argument for a name that is empty or taken.
  template <class T> Field<T> addField(std::string const& name, std::type_identity_t<T> const& background);
  /// @error std::invalid_argument for a name that is no field's, or one of another type.
  template <class T> Field<T> field(std::string const& name) const;
  template <class T> bool hasField(std::string const& name) const;
  bool hasField(std::string const& name) const;
  /// In the order of their making.
  std::vector<std::string> fieldNames() const;
  /// Its handles end.
  /// @error As field().
  void removeField(std::string const& name);

  // Tiles
  std::int64_t tileCount() const;
  /// Makes the finest tiles that a box meets. @space Tile space; `high` is exclusive.
  void addTiles(int3 const& low, int3 const& high);
  /// Makes tiles where the predicate asks for them: from the roots over a box downwards, each tile that it
  /// accepts, down to `depth`. Fields keep what was read there.
  /// @param predicate Called in parallel; not for the roots.
  void refineWhere(int3 const& low, int3 const& high, FunctionRef<bool(TileBox const&)> predicate,
                   int depth = Shape::kMaxDepth);
  /// Removes the finest tiles for which the predicate holds. There the fields read what coarser samples hold.
  /// @param predicate Called in parallel.
  /// @return How many went.
  std::int64_t removeWhere(FunctionRef<bool(TileBox const&)> predicate);
  /// Lets `change` grow the tree by its own calls. It may not remove or reorder tiles.
  void growTree(FunctionRef<void(Tree&)> change) { m_data->growTree(change); }

  // Derived values
  /// Coarse samples take the values of the finer ones below them, in all fields.
  void fillCoarse();
  /// Fills the halos of a field, or of all: see Field::halos().
  void fillHalos(std::string const& name);
  void fillHalos();

  // Points in this tree
  /// Puts points into the tiles that hold them, makes those that are missing, and gives them the name of
  /// their topology. Positions are the channel `name`_positions of object().
  /// @space World space.
  /// @return How many lie in the domain: the others are left out.
  std::int64_t addPoints(std::string const& name, std::span<float3 const> positions);
  /// Positions of the points of a name, tile by tile.
  /// @error std::invalid_argument for a name without points.
  std::vector<float3> points(std::string const& name) const;

  // The parts, in step when they are asked for: ask again after Field::set().
  float voxelSize() const { return m_data->tree->voxelSize(); }
  Tree const& tree() const {
    m_data->syncTree();
    return *m_data->tree;
  }
  Topology const& topology() const;
  /// Everything as one object, for the rest of the library. It keeps what it has: a volume that is written
  /// afterwards separates.
  VLN::Object object() const;

private:
  void checkNewName(std::string const& name) const;
  Internal::FieldSlot& findSlot(std::string const& name) const;
  Internal::FieldSlot& addSlot(std::unique_ptr<Internal::FieldSlot> slot);

  std::unique_ptr<Internal::VolumeData> m_data;
};

} // namespace VLN::TileTree3D
