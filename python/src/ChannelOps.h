// ChannelOps: what the module does with a channel, without its element type and without Python.
//
// One implementation for each element type is generated from ChannelOps.cpp.in. Elements travel as plain
// bytes in the order in which they lie in memory: an element of the type float3 is three floats.
#pragma once

#include "GeometryVolume/volume/Volume.h"

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

namespace VLN::Python {

using TileTree3D::Volume;
using Velorn::Math::double3;
using Velorn::Math::float3;
using Velorn::Math::int3;
using Shape = Volume::Shape;

inline constexpr int kFinest = Shape::kMaxDepth;
/// Edge of a sample. @units Samples of the deepest depth.
inline int sampleWidth(int depth) { return depth == kFinest ? 1 : Shape::width(depth) / Shape::kTDW; }

struct ElementInfo {
  std::string name; ///< "float3"
  char kind = 'f';  ///< as numpy has it: f, i, u
  int scalarBytes = 4;
  std::vector<int> shape; ///< {3} for float3, {} for float
  int bytes = 4;
  int components() const { return bytes / scalarBytes; }
};

/// A dense array that somebody else holds: steps in bytes, of any sign.
struct StridedArray {
  char const* data = nullptr;
  std::int64_t count[3] = {0, 0, 0};
  std::int64_t step[3] = {0, 0, 0};
  std::vector<std::int64_t> innerCount, innerStep; ///< of the components of an element
};

/// How to tell active samples; see Interop/VdbRecord.h.
struct ActiveRule {
  enum class Kind { kNotBackground, kInsideBand, kStates };
  Kind kind = Kind::kNotBackground;
  std::string states;     ///< name of the field of state bytes
  std::vector<int3> also; ///< active whatever their values
};

/// Active samples of the deepest depth, and wider ones.
struct ActiveSamples {
  struct Wide {
    int3 corner;
    int width;
  };
  std::vector<int3> voxels; ///< left empty when they are only counted
  std::vector<Wide> wide;
  std::int64_t count = 0;           ///< of voxels, those under wide samples included
  int3 low{0, 0, 0}, high{0, 0, 0}; ///< half open; meaningless without an active sample
};

/// Tiles of a depth as one block.
struct TileBlockView {
  void* data = nullptr;
  std::int64_t tiles = 0;
  int elements = 64;
  bool regular = false; ///< whether each tile lies behind the one before it
};

/// Refers to a volume, which stays as it is meanwhile unless an operation says otherwise.
class ChannelOps {
public:
  virtual ~ChannelOps() = default;
  /// @error std::invalid_argument for a name that is no field's.
  static std::unique_ptr<ChannelOps> of(Volume const& volume, std::string const& name);
  /// Makes a field. @error std::invalid_argument for a type that is none, and as Volume::addField().
  static std::unique_ptr<ChannelOps> add(Volume& volume, std::string const& name, std::string const& type,
                                         void const* background);
  /// Names of all element types of this build.
  static std::vector<ElementInfo> types();

  virtual ElementInfo const& element() const = 0;
  virtual void background(void* out) const = 0;

  /// A box of samples of a depth, x fastest.
  /// @param low In samples of that depth. @param between Called between parts of the work.
  virtual void dense(int3 const& low, int3 const& count, int depth, void* out,
                     FunctionRef<void()> between) const = 0;
  /// Blended values; of integers those of the nearest samples. NaN where a position is none.
  /// @param positions In tile space. @param gradients Null, or for float fields three floats for each
  /// position, in tile space.
  virtual void sample(double3 const* positions, std::int64_t count, void* out, float3* gradients) const = 0;
  virtual void get(int3 const* positions, std::int64_t count, void* out) const = 0;
  virtual ActiveSamples active(ActiveRule const& rule, bool positions) const = 0;

  /// Changes the volume.
  virtual void set(int3 const* positions, std::int64_t count, void const* values) = 0;
  /// Makes the tiles where some element is not the background, and writes them. Changes the volume.
  /// @param low Where element (0, 0, 0) goes.
  /// @param between Called between parts of the work.
  virtual void fromDense(StridedArray const& array, int3 const& low, double tolerance,
                         FunctionRef<void()> between) = 0;

  virtual TileBlockView block(int depth) const = 0;
  /// A copy of the channel whose tiles of a depth lie one behind the other.
  virtual Ostil::Ptr<TileTree3D::ChannelBase> packed() const = 0;
  /// Makes the elements the volume's alone, to be written. Changes the volume.
  virtual void prepareWrite() = 0;
};

} // namespace VLN::Python
