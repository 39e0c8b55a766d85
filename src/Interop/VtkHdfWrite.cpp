#include "Interop/VtkHdfWrite.h"

#include "Interop/AmrBoxesImpl.h"
#include "Interop/DenseReaderImpl.h"
#include "Interop/FileError.h"
#include "Interop/OutputFile.h"

#ifndef VLN_HDF5

namespace VLN::Interop {

bool writesVtkHdf() { return false; }

// As checkOutputFor() tells before the work.
void writeVtkHdf(std::string const& path, DenseVolume const&, Progress const&) {
  throw FileError(path, "this build writes no .vtkhdf files: it was made without HDF5");
}

} // namespace VLN::Interop

#else

#include "GeometryVolume/core/Parallel.h"
#include "Interop/FreeNameImpl.h"
#include "Interop/Hdf5Impl.h"

#include <algorithm>
#include <array>
#include <cmath>
#include <cstring>
#include <set>

namespace VLN::Interop {

namespace {

using TileTree3D::PowerOfTwoTraits;
using Velorn::Math::double3;

constexpr hsize_t kChunk = 32768;               ///< values
constexpr std::int64_t kValuesAtOnce = 4000000; ///< that are collected before they are handed on
constexpr std::size_t kMemoryStep = 16u << 20;  ///< by which the file grows in memory
constexpr unsigned kCompression = 1;            ///< of zlib's levels

/// Closes what it holds.
class Handle {
public:
  Handle(hid_t id, herr_t (*close)(hid_t))
      : m_id(id)
      , m_close(close) {}
  Handle(Handle const&) = delete;
  Handle& operator=(Handle const&) = delete;
  ~Handle() { m_close(m_id); }
  operator hid_t() const { return m_id; }

private:
  hid_t m_id;
  herr_t (*m_close)(hid_t);
};

/// HDF5 prints its errors unless told not to; they are told in one line here.
class QuietErrors {
public:
  explicit QuietErrors(Hdf5 const& hdf5)
      : m_hdf5(hdf5) {
    m_hdf5.H5Eget_auto2(H5E_DEFAULT, &m_print, &m_data);
    m_hdf5.H5Eset_auto2(H5E_DEFAULT, nullptr, nullptr);
  }
  QuietErrors(QuietErrors const&) = delete;
  QuietErrors& operator=(QuietErrors const&) = delete;
  ~QuietErrors() { m_hdf5.H5Eset_auto2(H5E_DEFAULT, m_print, m_data); }

private:
  Hdf5 const& m_hdf5;
  H5E_auto2_t m_print = nullptr;
  void* m_data = nullptr;
};

class Writer : Hdf5 {
public:
  Writer(std::string const& path, DenseVolume const& volume, Progress const& progress)
      : Hdf5(load(path))
      , m_path(path)
      , m_volume(volume)
      , m_progress(progress) {}

  void run() {
    QuietErrors const quiet(*this);
    plan();
    OutputFile out(m_path);
    Handle const access(check(H5Pcreate(H5P_CLS_FILE_ACCESS_ID_g)), H5Pclose);
    check(H5Pset_fapl_core(access, kMemoryStep, false));
    Handle const file(check(H5Fcreate("volume.vtkhdf", H5F_ACC_TRUNC, H5P_DEFAULT, access)), H5Fclose);
    writeRoot(file);
    check(H5Fflush(file, H5F_SCOPE_GLOBAL));
    auto const bytes = static_cast<std::size_t>(check(H5Fget_file_image(file, nullptr, 0)));
    void** image = nullptr; // this driver's handle is where the file lies
    check(H5Fget_vfd_handle(file, H5P_DEFAULT, reinterpret_cast<void**>(&image)));
    out.write(*image, bytes);
    out.commit();
    report("done", 1);
  }

private:
  template <class Result> Result check(Result result) const {
    if (result < 0) throw FileError(m_path, "HDF5 cannot make it: it may need more memory than there is");
    return result;
  }
  void report(char const* stage, double done) const {
    if (m_progress) m_progress(stage, done);
  }

  void plan() {
    report("laying out the levels", 0);
    if (m_volume.channels.empty()) throw FileError(m_path, "there is no channel to be written");
    auto const tree = m_volume.object.component<TileTree3D::Container<PowerOfTwoTraits>>(kVdbContainerName);
    if (tree) m_levels = amrLevels(*tree);
    if (m_levels.empty()) throw FileError(m_path, "the volume has no tile, and so no level to be written");
    std::set<std::string> taken{".", ".."};
    double values = 0, samples = 0;
    for (auto const& level : m_levels) samples += double(level.samples());
    for (auto const& name : m_volume.channels) {
      auto reader = DenseReader::of(m_volume.object, name);
      if (!reader)
        throw FileError(m_path, "the channel '" + oneLine(name, 60) + "' is of a type that is not written");
      values += samples * reader->components;
      std::string base = oneLine(name, 200);
      std::replace(base.begin(), base.end(), '/', '_');
      m_names.push_back(freeName(base, taken));
      m_readers.push_back(std::move(reader));
    }
    m_work = values;
    place();
  }

  /// Origin and spacing, in the world, of cells whose deepest ones lie round their voxels' places.
  void place() {
    auto const& map = m_volume.indexToWorld;
    if (map.besidesScale().rfind("not linear", 0) == 0)
      throw FileError(m_path, "the transform of the volume is not linear, which .vtkhdf files cannot tell");
    auto const& first = m_levels.front();
    for (int a = 0; a < 3; ++a) {
      m_low[a] = first.boxes.front().min[a];
      for (auto const& box : first.boxes) m_low[a] = std::min(m_low[a], box.min[a]);
    }
    double3 corner;
    for (int a = 0; a < 3; ++a) corner[a] = double(m_low[a]) * first.width - 0.5;
    m_origin = map.toWorld(corner);
    double3 const zero = map.toWorld({0, 0, 0});
    for (int a = 0; a < 3; ++a) {
      double3 unit{0, 0, 0};
      unit[a] = 1;
      double3 const axis = map.toWorld(unit) - zero;
      m_edge[a] = axis[a];
      double const others = std::abs(axis[(a + 1) % 3]) + std::abs(axis[(a + 2) % 3]);
      if (!(axis[a] > 0) || !(others <= 1e-9 * axis[a]))
        throw FileError(m_path, "the transform of the volume turns, mirrors or skews it, which .vtkhdf files "
                                "cannot tell");
    }
  }

  hid_t memoryType(DenseReader const& reader) const {
    bool const real = reader.kind == 'f', plain = reader.kind == 'u';
    switch (reader.scalarBytes) {
    case 1:
      return plain ? H5T_NATIVE_UINT8_g : H5T_NATIVE_INT8_g;
    case 2:
      return plain ? H5T_NATIVE_UINT16_g : H5T_NATIVE_INT16_g;
    case 4:
      return real ? H5T_NATIVE_FLOAT_g : plain ? H5T_NATIVE_UINT32_g : H5T_NATIVE_INT32_g;
    default:
      return real ? H5T_NATIVE_DOUBLE_g : plain ? H5T_NATIVE_UINT64_g : H5T_NATIVE_INT64_g;
    }
  }

  // Without times of creation: equal volumes make equal files.
  Handle group(hid_t parent, std::string const& name) const {
    Handle const how(check(H5Pcreate(H5P_CLS_GROUP_CREATE_ID_g)), H5Pclose);
    check(H5Pset_obj_track_times(how, false));
    return {check(H5Gcreate2(parent, name.c_str(), H5P_DEFAULT, how, H5P_DEFAULT)), H5Gclose};
  }
  void attribute(hid_t owner, char const* name, hid_t type, hid_t inMemory, hsize_t count,
                 void const* values) const {
    Handle const space(check(count ? H5Screate_simple(1, &count, nullptr) : H5Screate(H5S_SCALAR)), H5Sclose);
    Handle const made(check(H5Acreate2(owner, name, type, space, H5P_DEFAULT, H5P_DEFAULT)), H5Aclose);
    check(H5Awrite(made, inMemory, values));
  }
  void text(hid_t owner, char const* name, char const* value) const {
    Handle const type(check(H5Tcopy(H5T_C_S1_g)), H5Tclose);
    check(H5Tset_size(type, std::strlen(value)));
    check(H5Tset_strpad(type, H5T_STR_NULLPAD));
    attribute(owner, name, type, type, 0, value);
  }

  void writeRoot(hid_t file) {
    Handle const root = group(file, "VTKHDF");
    std::int64_t const version[2] = {1, 0};
    attribute(root, "Version", H5T_STD_I64LE_g, H5T_NATIVE_INT64_g, 2, version);
    text(root, "Type", "OverlappingAMR");
    text(root, "GridDescription", "XYZ");
    double const origin[3] = {m_origin.x, m_origin.y, m_origin.z};
    attribute(root, "Origin", H5T_IEEE_F64LE_g, H5T_NATIVE_DOUBLE_g, 3, origin);
    for (std::size_t n = 0; n < m_levels.size(); ++n) {
      Handle const level = group(root, "Level" + std::to_string(n));
      writeLevel(level, m_levels[n]);
    }
  }

  void writeLevel(hid_t group_, AmrLevel const& level) {
    double spacing[3];
    for (int a = 0; a < 3; ++a) spacing[a] = m_edge[a] * level.width;
    attribute(group_, "Spacing", H5T_IEEE_F64LE_g, H5T_NATIVE_DOUBLE_g, 3, spacing);
    // Numbers from the low corner on are never negative, and fit: the domain is 2^30 wide.
    int const ratio = m_levels.front().width / level.width;
    std::vector<std::int32_t> boxes;
    boxes.reserve(level.boxes.size() * 6);
    for (IndexBox const& box : level.boxes)
      for (int a = 0; a < 3; ++a) {
        std::int64_t const low = std::int64_t(m_low[a]) * ratio;
        boxes.push_back(static_cast<std::int32_t>(box.min[a] - low));
        boxes.push_back(static_cast<std::int32_t>(box.max[a] - 1 - low));
      }
    hsize_t const shape[2] = {level.boxes.size(), 6};
    Handle const how(check(H5Pcreate(H5P_CLS_DATASET_CREATE_ID_g)), H5Pclose);
    check(H5Pset_obj_track_times(how, false));
    Handle const space(check(H5Screate_simple(2, shape, nullptr)), H5Sclose);
    Handle const set(
        check(H5Dcreate2(group_, "AMRBox", H5T_STD_I32LE_g, space, H5P_DEFAULT, how, H5P_DEFAULT)), H5Dclose);
    check(H5Dwrite(set, H5T_NATIVE_INT32_g, H5S_ALL, H5S_ALL, H5P_DEFAULT, boxes.data()));
    for (char const* empty : {"PointData", "FieldData"}) group(group_, empty);
    Handle const cells = group(group_, "CellData");
    for (std::size_t n = 0; n < m_readers.size(); ++n) writeValues(cells, level, m_names[n], *m_readers[n]);
  }

  void writeValues(hid_t cells, AmrLevel const& level, std::string const& name, DenseReader const& reader) {
    auto const components = static_cast<hsize_t>(reader.components);
    int const rank = components > 1 ? 2 : 1;
    hsize_t const shape[2] = {static_cast<hsize_t>(level.samples()), components};
    hsize_t const chunk[2] = {std::min(kChunk / components, shape[0]), components};
    hid_t const type = memoryType(reader);
    Handle const how(check(H5Pcreate(H5P_CLS_DATASET_CREATE_ID_g)), H5Pclose);
    check(H5Pset_obj_track_times(how, false));
    check(H5Pset_chunk(how, rank, chunk));
    check(H5Pset_deflate(how, kCompression));
    Handle const space(check(H5Screate_simple(rank, shape, nullptr)), H5Sclose);
    Handle const set(check(H5Dcreate2(cells, name.c_str(), type, space, H5P_DEFAULT, how, H5P_DEFAULT)),
                     H5Dclose);
    std::size_t const bytes = static_cast<std::size_t>(reader.scalarBytes * reader.components);
    std::vector<std::byte> values;
    std::vector<std::size_t> offsets;
    hsize_t begin[2] = {0, 0};
    for (std::size_t box = 0; box < level.boxes.size();) {
      std::size_t count = 0, end = box;
      offsets.clear();
      for (; end < level.boxes.size() && std::int64_t(count) < kValuesAtOnce; ++end) {
        auto const side = static_cast<std::size_t>(level.boxes[end].max.x - level.boxes[end].min.x);
        offsets.push_back(count);
        count += side * side * side;
      }
      values.resize(count * bytes);
      fill(level, reader, box, offsets, bytes, values.data());
      hsize_t const part[2] = {count, components};
      check(H5Sselect_hyperslab(space, H5S_SELECT_SET, begin, nullptr, part, nullptr));
      Handle const inMemory(check(H5Screate_simple(rank, part, nullptr)), H5Sclose);
      check(H5Dwrite(set, type, inMemory, space, H5P_DEFAULT, values.data()));
      begin[0] += count;
      box = end;
      m_done += double(count) * reader.components;
      report("writing the levels", m_done / m_work);
    }
  }

  static void fill(AmrLevel const& level, DenseReader const& reader, std::size_t first,
                   std::vector<std::size_t> const& offsets, std::size_t bytes, std::byte* values) {
    parallelFor(0, static_cast<std::int64_t>(offsets.size()),
                [&](std::int64_t begin, std::int64_t end) {
                  for (auto n = begin; n < end; ++n) {
                    IndexBox const& box = level.boxes[first + n];
                    auto const side = static_cast<std::size_t>(box.max.x - box.min.x);
                    for (int z = box.min.z; z < box.max.z; ++z)
                      reader.slice(box, z, level.depth, 0, reader.components,
                                   values +
                                       (offsets[n] + static_cast<std::size_t>(z - box.min.z) * side * side) *
                                           bytes);
                  }
                },
                {.grain = 8});
  }

  std::string const& m_path;
  DenseVolume const& m_volume;
  Progress const& m_progress;
  std::vector<AmrLevel> m_levels;
  std::vector<std::string> m_names;
  std::vector<std::unique_ptr<DenseReader>> m_readers;
  std::array<int, 3> m_low{}; ///< of all boxes, in samples of the first level
  double3 m_origin{0, 0, 0};
  double m_edge[3] = {1, 1, 1}; ///< of a voxel
  double m_work = 1, m_done = 0;
};

} // namespace

bool writesVtkHdf() { return true; }

void writeVtkHdf(std::string const& path, DenseVolume const& volume, Progress const& progress) {
  Writer(path, volume, progress).run();
}

} // namespace VLN::Interop

#endif
