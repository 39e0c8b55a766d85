#include "Files.h"

#include "Interop/FileError.h"
#include "Interop/FileFormat.h"
#include "Interop/Ply.h"
#include "Interop/VdbExport.h"
#include "Interop/VolumeExport.h"
#include "Interop/VolumeFile.h"

#include <cstring>

namespace VLN::Python {

namespace {

using Interop::PointSet;

py::dict pointsToDict(PointSet const& set, std::string const& name) {
  py::dict result;
  auto const count = static_cast<py::ssize_t>(set.size());
  py::array_t<double> positions({count, py::ssize_t(3)});
  auto* const out = positions.mutable_data();
  for (py::ssize_t n = 0; n < count; ++n) {
    auto const p = set.world(static_cast<std::size_t>(n));
    out[3 * n] = p.x, out[3 * n + 1] = p.y, out[3 * n + 2] = p.z;
  }
  py::dict attributes;
  for (auto const& attribute : set.attributes)
    for (auto const& element : ChannelOps::types()) {
      if (element.name != attribute.type) continue;
      auto values = newArray(element, {count});
      std::memcpy(values.mutable_data(), attribute.bytes.data(),
                  std::min<std::size_t>(static_cast<std::size_t>(values.nbytes()), attribute.bytes.size()));
      attributes[py::cast(attribute.name)] = values;
    }
  result["name"] = name;
  result["positions"] = positions;
  result["attributes"] = attributes;
  result["voxel_size"] = set.voxelSize;
  return result;
}

PointSet pointsFromDict(py::dict const& points) {
  PointSet set;
  auto const positions = points["positions"].cast<Rows<double>>();
  auto const rows = rowCount(positions, "positions");
  set.voxelSize = points["voxel_size"].cast<double>();
  set.doublePositions = false;
  auto const* const from = reinterpret_cast<double3 const*>(positions.data());
  if (rows > 0) set.origin = from[0];
  set.positions.reserve(static_cast<std::size_t>(rows));
  for (py::ssize_t n = 0; n < rows; ++n) {
    double3 const p = (from[n] - set.origin) * (1 / set.voxelSize);
    set.positions.push_back({float(p.x), float(p.y), float(p.z)});
  }
  for (auto const& [key, value] : points["attributes"].cast<py::dict>()) {
    auto const values = value.cast<py::array>();
    auto const name = key.cast<std::string>();
    bool taken = false;
    for (auto const& element : ChannelOps::types()) {
      bool fits = values.dtype().equal(dtypeOf(element)) && (values.flags() & py::array::c_style) &&
                  values.ndim() == 1 + static_cast<py::ssize_t>(element.shape.size()) &&
                  values.shape(0) == rows;
      for (py::ssize_t a = 1; fits && a < values.ndim(); ++a)
        fits = values.shape(a) == element.shape[static_cast<std::size_t>(a - 1)];
      if (!fits || taken) continue;
      Interop::PointAttribute attribute{name, element.name, static_cast<std::size_t>(element.bytes), {}};
      attribute.bytes.resize(static_cast<std::size_t>(values.nbytes()));
      std::memcpy(attribute.bytes.data(), values.data(), attribute.bytes.size());
      set.attributes.push_back(std::move(attribute));
      taken = true;
    }
    if (!taken) throw py::type_error("the attribute '" + name + "' is no array that points can carry");
  }
  return set;
}

Interop::PointVolume pointVolume(py::dict const& points) {
  auto const set = pointsFromDict(points);
  auto const name = points["name"].cast<std::string>();
  py::gil_scoped_release const nogil;
  auto volume = Interop::buildPointVolume(set);
  volume.name = name;
  return volume;
}

} // namespace

py::tuple openFile(std::string const& path, std::string const& channels, double memoryBytes,
                   py::object const& progress) {
  Interop::VdbImport content;
  {
    Interop::VdbReadLimits limits;
    limits.channels = channels;
    limits.memoryBytes = memoryBytes > 0 ? static_cast<std::uint64_t>(memoryBytes) : 0;
    auto const tell = teller(progress);
    py::gil_scoped_release const nogil;
    UsingOpenVdb const alone;
    content = Interop::importVolumes(path, limits, tell);
  }
  py::list volumes, points, skipped;
  for (auto& volume : content.volumes) {
    std::shared_ptr<Core> core;
    {
      py::gil_scoped_release const nogil;
      core = std::make_shared<Core>(Volume(*volume.object), volume.indexToWorld);
      volume.object.reset();
    }
    volumes.append(core);
  }
  for (auto const& volume : content.points) {
    PointSet set;
    {
      py::gil_scoped_release const nogil;
      set = Interop::pointSetOf(volume);
    }
    points.append(pointsToDict(set, volume.name));
  }
  for (auto const& grid : content.skipped) skipped.append(py::make_tuple(grid.grid, grid.reason));
  return py::make_tuple(volumes, points, skipped);
}

void saveFile(std::vector<std::shared_ptr<Core>> const& volumes, py::list const& points,
              std::string const& path, bool voxelByVoxel, py::object const& progress) {
  Interop::VdbImport content;
  content.file = path;
  for (auto const& volume : volumes) content.volumes.push_back(volume->vdbVolume(path));
  for (auto const& dict : points) content.points.push_back(pointVolume(dict.cast<py::dict>()));
  auto const tell = teller(progress);
  py::gil_scoped_release const nogil;
  UsingOpenVdb const alone;
  Interop::exportVolumes(content, path, tell, {.surface = {}, .voxelByVoxel = voxelByVoxel});
}

void savePoints(py::dict const& points, std::string const& path) {
  auto const format = Interop::checkOutputFor(Interop::FileContent::kPointData, path);
  if (format == Interop::FileFormat::kPly) {
    auto const set = pointsFromDict(points);
    py::gil_scoped_release const nogil;
    return Interop::writePly(path, set);
  }
  Interop::VdbImport content;
  content.points.push_back(pointVolume(points));
  py::gil_scoped_release const nogil;
  UsingOpenVdb const alone;
  Interop::exportVdb(content, path);
}

} // namespace VLN::Python
