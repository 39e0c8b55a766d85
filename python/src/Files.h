// Files of several volumes and points, and points as arrays.
#pragma once

#include "Core.h"

namespace VLN::Python {

/// (volumes as Cores, points as dicts, skipped grids as pairs)
py::tuple openFile(std::string const& path, std::string const& channels, double memoryBytes,
                   py::object const& progress);

/// Volumes and points together, in the format of the suffix. @error As exportVolumes().
void saveFile(std::vector<std::shared_ptr<Core>> const& volumes, py::list const& points,
              std::string const& path, bool voxelByVoxel, py::object const& progress);

/// {"name", "positions", "attributes"} as a .vdb or .ply file.
void savePoints(py::dict const& points, std::string const& path);

} // namespace VLN::Python
