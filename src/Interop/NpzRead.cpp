// What the members of an .npz file mean:
//
//   NAME             [x, y, z] or [x, y, z, component]: every voxel of a box
//   NAME.indices     (N, 3) integers, and NAME.values (N) or (N, components): voxels one by one
//   NAME.background  one value: what holds elsewhere; 0 where it is not told
//   low              three integers: the index of element [0, 0, 0] of the boxes; 0 where it is not told
//   to_world         (4, 4): from an element's place in its array to the world; or
//   voxel_size       one number or three, and origin, three numbers
#include "Interop/ArrayFiles.h"

#include "Interop/ArrayGridImpl.h"
#include "Interop/FileFormat.h"
#include "Interop/GuardedReadImpl.h"
#include "Interop/RegularFileImpl.h"
#include "Interop/VdbImportImpl.h"
#include "Interop/ZipReaderImpl.h"

#include <algorithm>
#include <charconv>
#include <cmath>
#include <fstream>
#include <limits>
#include <map>
#include <set>

namespace VLN::Interop {

namespace {

constexpr std::string_view kIndices = ".indices", kValues = ".values", kBackground = ".background";

struct Array {
  std::string descr; ///< as numpy has it
  NumberType type;
  bool known = false; ///< whether its type is one of numbers
  bool fortran = false;
  std::vector<std::int64_t> shape;
  std::string bytes;
  std::size_t begin = 0; ///< of the numbers

  std::byte const* data() const { return reinterpret_cast<std::byte const*>(bytes.data()) + begin; }
  std::size_t axes() const { return shape.size(); }
  std::int64_t size() const {
    std::int64_t n = 1;
    for (auto const side : shape)
      if (side == 0) return 0;
    for (auto const side : shape) n *= side;
    return n;
  }
  /// In bytes, for each axis.
  std::vector<std::int64_t> strides() const {
    std::vector<std::int64_t> result(shape.size());
    if (size() == 0) return result;
    std::int64_t step = type.bytes;
    for (std::size_t n = 0; n < shape.size(); ++n) {
      std::size_t const axis = fortran ? n : shape.size() - 1 - n;
      result[axis] = step;
      step *= shape[axis];
    }
    return result;
  }
  double at(std::int64_t n) const { return realOf(data() + n * type.bytes, type); }
};

[[noreturn]] void damaged(std::string const& name, std::string const& what) {
  throw UnreadableArrays("its array '" + oneLine(name, 60) + "' " + what);
}

/// The value of a key of the head, as text up to where the next one begins.
std::string_view valueOf(std::string_view head, std::string_view key) {
  for (char const quote : {'\'', '"'}) {
    auto const at = head.find(quote + std::string(key) + quote);
    if (at == std::string_view::npos) continue;
    auto begin = head.find(':', at + key.size() + 2);
    if (begin == std::string_view::npos) return {};
    begin = head.find_first_not_of(" \t\n", begin + 1);
    return begin == std::string_view::npos ? std::string_view{} : head.substr(begin);
  }
  return {};
}

void parseType(Array& array) {
  std::string_view text = array.descr;
  array.type.bigEndian = text.starts_with('>');
  if (text.starts_with('<') || text.starts_with('>') || text.starts_with('|') || text.starts_with('='))
    text.remove_prefix(1);
  if (text.size() != 2) return;
  array.type.kind = text[0];
  array.type.bytes = text[1] - '0';
  std::string_view const numbers[] = {"b1", "i1", "u1", "i2", "u2", "i4", "u4", "i8", "u8", "f2", "f4", "f8"};
  array.known = std::find(std::begin(numbers), std::end(numbers), text) != std::end(numbers);
}

Array parseArray(std::string const& name, std::string bytes) {
  Array array;
  array.bytes = std::move(bytes);
  std::string_view const all = array.bytes;
  if (!all.starts_with("\x93NUMPY") || all.size() < 12) damaged(name, "does not begin as one");
  auto const byte = [&](std::size_t n) { return std::size_t(static_cast<unsigned char>(all[n])); };
  bool const wide = byte(6) > 1;
  std::size_t const length = byte(8) | byte(9) << 8 | (wide ? byte(10) << 16 | byte(11) << 24 : 0);
  std::size_t const from = wide ? 12 : 10;
  if (length > all.size() - from) damaged(name, "is truncated");
  array.begin = from + length;
  auto const head = all.substr(from, length);
  auto const descr = valueOf(head, "descr"), order = valueOf(head, "fortran_order"),
             shape = valueOf(head, "shape");
  if (descr.empty() || order.empty() || !shape.starts_with('(')) damaged(name, "has a head that is none");
  array.fortran = order.starts_with("True");
  if (descr[0] == '\'' || descr[0] == '"')
    array.descr = descr.substr(1, std::min(descr.find(descr[0], 1), descr.size()) - 1);
  else
    array.descr = "fields"; // a list of names and types
  parseType(array);
  auto const end = shape.find(')');
  if (end == std::string_view::npos) damaged(name, "has a head that is none");
  double elements = 1;
  for (char const *p = shape.data() + 1, *last = shape.data() + end; p < last;) {
    if (*p == ' ' || *p == ',') {
      ++p;
      continue;
    }
    std::int64_t side = 0;
    auto const parsed = std::from_chars(p, last, side);
    if (parsed.ec != std::errc() || side < 0) damaged(name, "has a shape that is none");
    array.shape.push_back(side);
    elements *= double(side);
    p = parsed.ptr;
  }
  if (!array.known) return array;
  if (!(elements <= 1e15) || array.axes() > 32 ||
      array.size() != std::int64_t((all.size() - array.begin) / std::size_t(array.type.bytes)) ||
      (all.size() - array.begin) % std::size_t(array.type.bytes) != 0)
    damaged(name, "has another size than its shape says");
  return array;
}

class NpzReader {
public:
  explicit NpzReader(std::string const& path)
      : m_bytes(regularFileContent(path))
      , m_zip(m_bytes) {
    m_file.path = path;
  }

  VdbFile run() {
    openvdb::initialize();
    for (auto const& member : m_zip.members()) {
      std::string name = member.name;
      if (name.ends_with(".npy")) name.resize(name.size() - 4);
      if (!m_arrays.emplace(name, nullptr).second) continue;
      m_names.push_back(name);
      m_members[name] = &member;
    }
    readPlaces();
    for (auto const& name : m_names)
      if (!m_taken.contains(name)) readBox(name);
    // The names of the rest may have been those of pairs.
    for (auto const& name : m_names)
      if (m_taken.insert(name).second) skip(name, "there is nothing that its values belong to");
    return std::move(m_file);
  }

private:
  void skip(std::string const& name, std::string const& why) { m_file.skipped.push_back({name, why}); }

  /// Null where there is no such array. One that is no longer needed can be dropped.
  Array const* find(std::string const& name) {
    auto const found = m_arrays.find(name);
    if (found == m_arrays.end()) return nullptr;
    if (!found->second)
      found->second = std::make_unique<Array>(parseArray(name, m_zip.content(*m_members.at(name))));
    return found->second.get();
  }
  void drop(std::string const& name) { m_arrays.at(name).reset(); }

  /// The numbers of a small array, where its shape is one of these.
  bool numbers(std::string const& name, std::vector<std::vector<std::int64_t>> const& shapes, double* to) {
    Array const* const array = find(name);
    if (!array || !array->known || std::find(shapes.begin(), shapes.end(), array->shape) == shapes.end())
      return false;
    auto const strides = array->strides();
    bool const matrix = array->axes() == 2;
    for (std::int64_t n = 0; n < array->size(); ++n)
      to[n] =
          realOf(array->data() + (matrix ? n / 4 * strides[0] + n % 4 * strides[1] : n * array->type.bytes),
                 array->type);
    m_taken.insert(name);
    return true;
  }

  void readPlaces() {
    double low[3] = {0, 0, 0}, matrix[16], size[3] = {1, 1, 1}, origin[3] = {0, 0, 0};
    if (numbers("low", {{3}}, low))
      for (int a = 0; a < 3; ++a) {
        checkIndex(low[a]);
        m_low[a] = static_cast<int>(low[a]);
      }
    double rows[3][4] = {};
    if (numbers("to_world", {{4, 4}}, matrix)) {
      for (int row = 0; row < 3; ++row)
        for (int column = 0; column < 4; ++column) rows[row][column] = matrix[4 * row + column];
      // From an element's place, which lies at its index less `low`.
      for (auto& row : rows)
        for (int a = 0; a < 3; ++a) row[3] -= row[a] * m_low[a];
    } else {
      if (numbers("voxel_size", {{}, {1}}, size)) size[1] = size[2] = size[0];
      numbers("voxel_size", {{3}}, size);
      numbers("origin", {{3}}, origin);
      for (int a = 0; a < 3; ++a) rows[a][a] = size[a], rows[a][3] = origin[a];
    }
    m_transform = transformOfRows(rows);
  }

  void setBackground(std::string const& name, ArrayGrid& grid, int components) {
    std::string const key = name + std::string(kBackground);
    Array const* const array = find(key);
    if (!array) return;
    if (!array->known || array->size() != components)
      damaged(key, "is no value of '" + oneLine(name, 60) + "'");
    grid.setBackground(array->data(), array->type);
    m_taken.insert(key);
  }

  void add(std::string const& name, ArrayGrid const& grid) {
    grid.grid()->setName(name);
    grid.grid()->setTransform(m_transform);
    m_file.grids.push_back(grid.grid());
  }

  void readBox(std::string const& name) {
    for (auto const suffix : {kIndices, kValues}) {
      if (!name.ends_with(suffix) && name != suffix.substr(1)) continue;
      bool const plain = name == suffix.substr(1); // the pair "indices", "values" alone
      std::string const base = plain ? "" : name.substr(0, name.size() - suffix.size());
      std::string const indices = plain ? "indices" : base + std::string(kIndices),
                        values = plain ? "values" : base + std::string(kValues);
      if (m_arrays.contains(indices) && m_arrays.contains(values))
        return readPair(plain ? "values" : base, indices, values);
    }
    if (name.ends_with(kBackground) && m_arrays.contains(name.substr(0, name.size() - kBackground.size())))
      return;
    m_taken.insert(name);
    Array const& array = *find(name);
    int const components =
        array.axes() == 4 ? static_cast<int>(std::min<std::int64_t>(array.shape[3], 9)) : 1;
    if (array.axes() != 3 && array.axes() != 4) {
      skip(name, "an array of " + std::to_string(array.axes()) + " axes is no box of voxels");
      return drop(name);
    }
    auto const grid = array.known ? ArrayGrid::of(array.type, components) : nullptr;
    if (!grid) {
      skip(name, "arrays of " + oneLine(array.descr, 20) +
                     (array.axes() == 4 ? " with " + std::to_string(array.shape[3]) + " components" : "") +
                     " are not read");
      return drop(name);
    }
    setBackground(name, *grid, components);
    auto const strides = array.strides();
    ArrayLayout layout;
    for (std::size_t a = 0; a < 3; ++a) {
      checkIndex(double(m_low[int(a)]) + double(array.shape[a]));
      layout.count[a] = array.shape[a];
      layout.stride[a] = strides[a];
    }
    if (array.axes() == 4) layout.componentStride = strides[3];
    grid->setBox(array.data(), array.type, layout, m_low);
    add(name, *grid);
    drop(name);
  }

  void readPair(std::string const& name, std::string const& indices, std::string const& values) {
    m_taken.insert({indices, values});
    Array const &at = *find(indices), &array = *find(values);
    if (!at.known || at.type.kind == 'f' || at.type.kind == 'b' || at.axes() != 2 || at.shape[1] != 3)
      damaged(indices, "is no list of indices: integers of shape (N, 3)");
    if ((array.axes() != 1 && array.axes() != 2) || array.shape[0] != at.shape[0])
      damaged(values, "is not as long as its indices");
    int const components =
        array.axes() == 2 ? static_cast<int>(std::min<std::int64_t>(array.shape[1], 9)) : 1;
    auto const grid = array.known ? ArrayGrid::of(array.type, components) : nullptr;
    if (!grid) return skip(name, "arrays of " + oneLine(array.descr, 20) + " are not read");
    setBackground(name, *grid, components);
    auto const places = at.strides(), strides = array.strides();
    for (std::int64_t n = 0; n < at.shape[0]; ++n) {
      openvdb::Coord voxel;
      for (int a = 0; a < 3; ++a) {
        auto const index = wholeOf(at.data() + n * places[0] + a * places[1], at.type);
        checkIndex(double(index) + m_low[a]);
        voxel[a] = static_cast<int>(index + m_low[a]);
      }
      grid->setVoxel(voxel, array.data() + n * strides[0], array.type, components > 1 ? strides[1] : 0);
    }
    add(name, *grid);
    drop(indices);
    drop(values);
  }

  std::string m_bytes;
  ZipReader m_zip;
  VdbFile m_file;
  std::vector<std::string> m_names; ///< in the order of the archive
  std::map<std::string, ZipReader::Member const*> m_members;
  std::map<std::string, std::unique_ptr<Array>> m_arrays;
  std::set<std::string> m_taken;
  openvdb::Coord m_low{0, 0, 0};
  openvdb::math::Transform::Ptr m_transform;
};

} // namespace

bool isNpzFile(std::string const& path) {
  if (formatOf(path) == FileFormat::kNpz) return true;
  char magic[4] = {};
  std::ifstream(path, std::ios::binary).read(magic, sizeof magic);
  return std::string_view(magic, 4) == "PK\x03\x04";
}

VdbImport importNpz(std::string const& path, VdbReadLimits const& asked, Progress const& progress) {
  if (progress) progress("reading", 0);
  openvdb::initialize();
  VdbFile file = readGuarded(path, asked, regularFileSize(path), [&] { return NpzReader(path).run(); });
  return importGrids(file, asked, progress);
}

} // namespace VLN::Interop
