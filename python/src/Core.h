// Core: the volume that Python's classes Volume and Channel work on. Each call takes what it needs from
// Python, lets go of the interpreter's lock, works, and comes back.
#pragma once

#include "Arrays.h"
#include "State.h"

#include "Interop/Flatten.h"
#include "Interop/PointVolume.h"
#include "Interop/VdbImport.h"

#include <array>
#include <memory>
#include <optional>
#include <string>

namespace VLN::Python {

/// Tells Python, and lets it act on signals. `progress` may be None, and must outlive the result.
Interop::Progress teller(py::object const& progress);

using Long3 = std::array<std::int64_t, 3>;

/// What .vdb files know of a grid beyond its values.
struct GridNote {
  std::string type; ///< "bool" and "mask" have channels of bytes
  ActiveRule rule;
};

class Core {
public:
  Core(double voxelSize, std::array<double, 3> const& origin);
  Core(Volume volume, Interop::IndexToWorld const& indexToWorld);

  std::vector<std::string> names() const;
  /// (element type, dtype, shape of an element, type in files)
  py::tuple typeOf(std::string const& name) const;
  py::array background(std::string const& name) const;
  /// @param type As ChannelOps::types() names it, or "bool". @param gridClass For .vdb files, such as "level
  /// set".
  void add(std::string const& name, std::string const& type, py::array const& background,
           std::string const& gridClass);
  void removeChannel(std::string const& name);

  py::object box(std::string const& name) const;
  std::int64_t activeCount(std::string const& name) const;
  py::array active(std::string const& name) const;
  py::array toNumpy(std::string const& name, Long3 const& low, Long3 const& count, int depth) const;
  py::object sample(std::string const& name, Rows<double> const& xyz, bool gradient, bool world) const;
  py::array get(std::string const& name, Rows<int> const& ijk) const;
  void set(std::string const& name, Rows<int> const& ijk, py::array const& values);
  void fromNumpy(std::string const& name, py::array const& array, Long3 const& low, double tolerance);

  py::array values(std::string const& name, int depth, bool writable);
  void beginWrite(std::string const& name);
  py::array origins(int depth) const;
  std::vector<std::int64_t> tileCounts() const;
  int rootDepth() const;
  int views() const { return m_state->views(); }

  void refineAll(Long3 const& low, Long3 const& high, int depth);
  /// Makes the tiles whose corners are listed, for depths from the first below the roots.
  void refineTiles(std::vector<Rows<int>> const& corners, int firstDepth);
  /// Removes tiles of the deepest depth by their corners.
  std::int64_t removeTiles(Rows<int> const& corners);
  void fillHalos(std::optional<std::string> const& name);
  void fillCoarse();

  py::array toWorld(Rows<double> const& ijk) const { return transform(ijk, true); }
  py::array toIndex(Rows<double> const& xyz) const { return transform(xyz, false); }
  double voxelSize() const;
  std::string besidesScale() const { return m_state->indexToWorld.besidesScale(); }
  std::uint64_t bytes() const;

  /// A slice across an axis as the bytes of a PNG file. @param at World position on the axis.
  py::bytes picture(std::string const& name, int axis, std::optional<double> at, int size,
                    bool gradient) const;

  /// A picture by rays as the bytes of a PNG file. @param how What was asked for, by name.
  py::bytes render(std::string const& name, int width, int height, py::dict const& how,
                   py::object const& progress) const;

  void save(std::string const& path) const;
  /// As .npz, .vti or .zarr; of the last, `depth` does not count.
  void saveDense(std::string const& path, Long3 const& low, Long3 const& high, int depth,
                 py::object const& progress) const;
  std::shared_ptr<Interop::FlatVolume> flatten(Interop::FlattenOptions const& options) const;
  /// As a file's writer has it. @error As Interop::writtenVolume().
  Interop::VdbVolume vdbVolume(std::string const& path) const;

private:
  py::array transform(Rows<double> const& from, bool toWorld) const;
  void pack(std::string const& name);
  std::map<std::string, GridNote> notes() const;
  ActiveRule ruleOf(std::string const& name) const;

  std::shared_ptr<State> m_state;
};

} // namespace VLN::Python
