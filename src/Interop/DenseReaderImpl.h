// DenseReader: channels of any file type as slices of a dense box.
#pragma once

#include "GeometryVolume/core/Object.h"
#include "Interop/DenseWrite.h"

#include <cstddef>
#include <memory>
#include <string>
#include <vector>

namespace VLN::Interop {

class DenseReader {
public:
  /// Of the types that files have; null for others, and where there is no such channel. Keeps what it reads.
  static std::unique_ptr<DenseReader> of(Object const& object, std::string const& channel);
  virtual ~DenseReader() = default;

  char kind = 'f'; ///< of a component: f, i or u
  int scalarBytes = 4;
  int components = 1;

  /// Components [first, last) of the slice of samples at `z`, x fastest, those of a sample side by side.
  /// @param box Of samples of that depth. @param out Holds exactly that.
  virtual void slice(IndexBox const& box, int z, int depth, int first, int last, std::byte* out) const = 0;
  /// The components of the value that holds where nothing is.
  virtual std::vector<std::byte> background() const = 0;
};

inline constexpr double kMostDenseBytes = 1e12; ///< of a channel in a file

/// Checked: what a dense file will hold.
struct DensePlan {
  IndexBox box; ///< of samples of the depth
  int width = 1;
  std::int64_t count[3] = {0, 0, 0};
  double toWorld[3][4]; ///< rows of the matrix from sample indices to world space
  std::vector<std::string> names;
  std::vector<std::unique_ptr<DenseReader>> readers;
  std::int64_t samples() const { return count[0] * count[1] * count[2]; }
};

/// @error FileError that names `path`: for a volume without a channel or a voxel, or what no file would hold.
/// @param sparse Whether the file leaves out what is empty: then any box will do.
DensePlan planDense(std::string const& path, DenseVolume const& volume, bool sparse = false);

} // namespace VLN::Interop
