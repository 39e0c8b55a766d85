// The active voxels of grids, one by one, for numpy.
#include "Interop/DenseReaderImpl.h"
#include "Interop/NpzArchiveImpl.h"
#include "Interop/VdbExportImpl.h"
#include "Interop/VdbImportImpl.h"

#include <memory>

namespace VLN::Interop {

namespace {

constexpr std::size_t kAtOnce = 1 << 18;

struct Kind {
  std::string descr;
  int components = 1;
};

template <class T> Kind kindOf() {
  if constexpr (requires { T::size; }) {
    return {kindOf<typename T::value_type>().descr, int(T::size)};
  } else if constexpr (std::is_same_v<T, bool> || std::is_same_v<T, openvdb::ValueMask>) {
    return {"|b1"};
  } else
    return {std::string("<") + (std::is_floating_point_v<T> ? "f" : "i") + std::to_string(sizeof(T))};
}

/// Calls f(index, value) for every active voxel, those of tiles too, always in the same order.
template <class GridT> void overVoxels(GridT const& grid, auto const& f) {
  for (auto it = grid.tree().cbeginValueOn(); it; ++it) {
    openvdb::CoordBBox box;
    it.getBoundingBox(box);
    auto const value = it.getValue();
    for (auto at = box.begin(); at; ++at) f(*at, value);
  }
}

template <class GridT>
bool tryWrite(openvdb::GridBase const& base, std::string const& path, ZipWriter& zip,
              std::string const& name) {
  if (!base.isType<GridT>()) return false;
  auto const& grid = static_cast<GridT const&>(base);
  using Value = typename GridT::ValueType;
  Kind const kind = kindOf<Value>();
  auto const count = static_cast<std::int64_t>(grid.activeVoxelCount());
  if (double(count) * (12 + sizeof(Value)) > kMostDenseBytes)
    throw FileError(path, "the active voxels of '" + oneLine(name, 60) + "' would take more than 1000 GB");
  std::string bytes;
  auto const put = [&](void const* from, std::size_t size) {
    bytes.append(static_cast<char const*>(from), size);
    if (bytes.size() >= kAtOnce) zip.write(bytes.data(), bytes.size()), bytes.clear();
  };
  auto const member = [&](std::string const& what, std::string const& descr,
                          std::vector<std::int64_t> const& shape, auto const& each) {
    zip.begin(name + what + ".npy");
    std::string const header = npyHeader(descr, shape, false);
    put(header.data(), header.size());
    overVoxels(grid, each);
    zip.write(bytes.data(), bytes.size());
    bytes.clear();
    zip.end();
  };
  member(".indices", "<i4", {count, 3}, [&](openvdb::Coord const& at, auto const&) { put(at.data(), 12); });
  std::vector<std::int64_t> shape{count};
  if (kind.components > 1) shape.push_back(kind.components);
  member(".values", kind.descr, shape, [&](openvdb::Coord const&, auto const& value) {
    if constexpr (std::is_same_v<GridT, openvdb::MaskGrid>)
      put("\1", 1);
    else
      put(&value, sizeof value);
  });
  shape.erase(shape.begin());
  if constexpr (std::is_same_v<GridT, openvdb::MaskGrid>)
    writeSmall(zip, name + ".background", kind.descr, shape, "\0", 1);
  else
    writeSmall(zip, name + ".background", kind.descr, shape, &grid.background(), sizeof(Value));
  return true;
}

} // namespace

void writeNpzVoxels(std::string const& path, VdbImport const& content, Progress const& progress) {
  auto const grids = exportedGrids(content, [&](char const* stage, double done) {
    if (progress) progress(stage, 0.5 * done);
  });
  if (grids.empty()) throw FileError(path, "there is no grid to be written");
  IndexToWorld const& map = content.volumes.front().indexToWorld;
  if (map.besidesScale().rfind("not linear", 0) == 0)
    throw FileError(path, "the transform of the volume is not linear, which .npz files cannot tell");
  OutputFile out(path);
  auto const zip = std::make_unique<ZipWriter>(out);
  std::set<std::string> taken{"low", "to_world"};
  double done = 0;
  for (auto const& grid : grids) {
    using namespace openvdb;
    auto const name = memberName(grid->getName(), taken);
    bool const known =
        tryWrite<FloatGrid>(*grid, path, *zip, name) || tryWrite<DoubleGrid>(*grid, path, *zip, name) ||
        tryWrite<Int32Grid>(*grid, path, *zip, name) || tryWrite<Int64Grid>(*grid, path, *zip, name) ||
        tryWrite<BoolGrid>(*grid, path, *zip, name) || tryWrite<MaskGrid>(*grid, path, *zip, name) ||
        tryWrite<Vec3SGrid>(*grid, path, *zip, name) || tryWrite<Vec3DGrid>(*grid, path, *zip, name) ||
        tryWrite<Vec3IGrid>(*grid, path, *zip, name);
    if (!known)
      throw FileError(path, "the grid '" + oneLine(name, 60) + "' is of a type that is not written");
    if (progress) progress("writing", 0.5 + 0.5 * ++done / double(grids.size()));
  }
  double matrix[4][4] = {};
  auto const origin = map.toWorld({0, 0, 0});
  for (int a = 0; a < 3; ++a) {
    Velorn::Math::double3 unit{0, 0, 0};
    unit[a] = 1;
    auto const axis = map.toWorld(unit) - origin;
    for (int row = 0; row < 3; ++row) matrix[row][a] = axis[row];
    matrix[a][3] = origin[a];
  }
  matrix[3][3] = 1;
  writeSmall(*zip, "to_world", "<f8", {4, 4}, matrix, sizeof matrix);
  zip->finish();
  out.commit();
  if (progress) progress("done", 1);
}

} // namespace VLN::Interop
