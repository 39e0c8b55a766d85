#include "Interop/FileError.h"
#include "Interop/Ply.h"
#include "Interop/PlyMeshImpl.h"
#include "Interop/RegularFileImpl.h"

#include <algorithm>
#include <array>
#include <bit>
#include <charconv>
#include <cmath>
#include <cstring>
#include <fstream>
#include <iterator>
#include <limits>
#include <set>
#include <sstream>

namespace VLN::Interop {

namespace {

using Velorn::Math::double3;

constexpr std::size_t kLongestHeader = 1 << 16;
constexpr std::size_t kMostElements = 64, kMostProperties = 256;

enum class Scalar { kInt8, kUint8, kInt16, kUint16, kInt32, kUint32, kFloat, kDouble };
constexpr std::array<std::size_t, 8> kSizes{1, 1, 2, 2, 4, 4, 4, 8};
std::size_t sizeOf(Scalar s) { return kSizes[static_cast<std::size_t>(s)]; }

bool scalarNamed(std::string const& name, Scalar& out) {
  static constexpr char const* kNames[8][2] = {{"char", "int8"},     {"uchar", "uint8"},   {"short", "int16"},
                                               {"ushort", "uint16"}, {"int", "int32"},     {"uint", "uint32"},
                                               {"float", "float32"}, {"double", "float64"}};
  for (std::size_t n = 0; n < 8; ++n) {
    if (name == kNames[n][0] || name == kNames[n][1]) {
      out = static_cast<Scalar>(n);
      return true;
    }
  }
  return false;
}

bool isFinite(double3 const& p) { return std::isfinite(p.x) && std::isfinite(p.y) && std::isfinite(p.z); }

/// Of the points that are somewhere: what stands beside a coordinate that is no number may be anything.
/// Without one the low corner lies above the high one.
struct Extent {
  double low[3], high[3];

  explicit Extent(std::vector<double3> const& points) {
    std::fill(low, low + 3, std::numeric_limits<double>::infinity());
    std::fill(high, high + 3, -std::numeric_limits<double>::infinity());
    for (double3 const& p : points) {
      if (!isFinite(p)) continue;
      for (int a = 0; a < 3; ++a) low[a] = std::min(low[a], p[a]), high[a] = std::max(high[a], p[a]);
    }
  }
};

struct Property {
  std::string name;
  Scalar type = Scalar::kFloat;
  bool isList = false;
  Scalar countType = Scalar::kUint8;
};
struct Element {
  std::string name;
  std::uint64_t count = 0;
  std::vector<Property> properties;
};
enum class Format { kText, kLittle, kBig };

/// Reads a file's bytes; every step asks whether they are there.
class Parser {
public:
  Parser(std::string const& path, char const* data, std::size_t size)
      : m_path(path)
      , m_next(data)
      , m_end(data + size) {}

  PointSet run(PlyOptions const& options) {
    readHeader();
    bool found = false;
    for (Element const& element : m_elements) {
      if (element.name == "vertex") {
        readVertices(element);
        found = true;
        break; // what follows the points is not looked at
      }
      skip(element);
    }
    if (!found) fail("has no element 'vertex'");
    return place(options);
  }

  void runMesh(Mesh& mesh) {
    readHeader();
    bool faces = false;
    for (Element const& element : m_elements) {
      if (element.name == "vertex") {
        readVertices(element);
      } else if (element.name == "face") {
        readFaces(element, mesh);
        faces = true;
        break;
      } else {
        skip(element);
      }
    }
    if (!faces) fail("has no element 'face'");
    mesh.points = std::move(m_world);
  }

private:
  [[noreturn]] void fail(std::string const& reason) const { throw FileError(m_path, reason); }
  [[noreturn]] void failTruncated() const { fail("is truncated: data that its header announces is missing"); }
  std::uint64_t left() const { return static_cast<std::uint64_t>(m_end - m_next); }

  // --- Header

  std::string headerLine() {
    char const* const limit = m_next + std::min<std::uint64_t>(left(), kLongestHeader - m_headerBytes);
    char const* const end = std::find(m_next, limit, '\n');
    if (end == limit)
      fail(limit == m_end ? "is truncated: its header does not end" : "has too long a header");
    std::string line(m_next, end);
    m_headerBytes += static_cast<std::size_t>(end + 1 - m_next);
    m_next = end + 1;
    if (!line.empty() && line.back() == '\r') line.pop_back();
    return line;
  }
  void readHeader() {
    if (left() == 0) fail("is empty");
    if (left() < 4 || std::memcmp(m_next, "ply", 3) != 0 || (m_next[3] != '\n' && m_next[3] != '\r'))
      fail("is not a .ply file");
    headerLine();
    bool hasFormat = false;
    for (;;) {
      std::string const text = headerLine();
      std::istringstream line(text);
      std::string word;
      line >> word;
      if (word == "end_header") break;
      if (word.empty() || word == "comment" || word == "obj_info") continue;
      if (word == "format") {
        std::string format, version;
        line >> format >> version;
        if (format == "ascii")
          m_format = Format::kText;
        else if (format == "binary_little_endian")
          m_format = Format::kLittle;
        else if (format == "binary_big_endian")
          m_format = Format::kBig;
        else
          fail("has the unknown format '" + oneLine(format, 40) + "'");
        hasFormat = true;
      } else if (word == "element") {
        readElement(line, text);
      } else if (word == "property") {
        readProperty(line, text);
      } else {
        fail("has a header line that is not known: '" + oneLine(text, 60) + "'");
      }
    }
    if (!hasFormat) fail("does not tell its format");
  }
  void readElement(std::istringstream& line, std::string const& text) {
    Element element;
    std::string count, more;
    if (!(line >> element.name >> count) || line >> more)
      fail("has a bad element: '" + oneLine(text, 60) + "'");
    auto const parsed = std::from_chars(count.data(), count.data() + count.size(), element.count);
    if (parsed.ec != std::errc() || parsed.ptr != count.data() + count.size())
      fail("has an element with a bad count: '" + oneLine(text, 60) + "'");
    for (Element const& other : m_elements) {
      if (other.name == element.name) fail("has the element '" + oneLine(element.name, 40) + "' twice");
    }
    if (m_elements.size() == kMostElements) fail("has too many elements");
    m_elements.push_back(std::move(element));
  }
  void readProperty(std::istringstream& line, std::string const& text) {
    if (m_elements.empty()) fail("has a property before the first element");
    Property property;
    std::string type, more;
    line >> type;
    property.isList = type == "list";
    if (property.isList) {
      std::string countType;
      line >> countType >> type;
      if (!scalarNamed(countType, property.countType))
        fail("has a property of the unknown type '" + oneLine(countType, 40) + "'");
    }
    if (!scalarNamed(type, property.type))
      fail("has a property of the unknown type '" + oneLine(type, 40) + "'");
    if (!(line >> property.name) || line >> more) fail("has a bad property: '" + oneLine(text, 60) + "'");
    auto& properties = m_elements.back().properties;
    for (Property const& other : properties) {
      if (other.name == property.name) fail("has the property '" + oneLine(property.name, 40) + "' twice");
    }
    if (properties.size() == kMostProperties) fail("has too many properties");
    properties.push_back(std::move(property));
  }

  // --- Values

  /// One value, as its own type's bytes in this machine's order.
  struct Value {
    Scalar type;
    std::byte bytes[8];

    template <class T> T as() const {
      T v;
      std::memcpy(&v, bytes, sizeof v);
      return v;
    }
    double number() const {
      switch (type) {
      case Scalar::kInt8:
        return as<std::int8_t>();
      case Scalar::kUint8:
        return as<std::uint8_t>();
      case Scalar::kInt16:
        return as<std::int16_t>();
      case Scalar::kUint16:
        return as<std::uint16_t>();
      case Scalar::kInt32:
        return as<std::int32_t>();
      case Scalar::kUint32:
        return as<std::uint32_t>();
      case Scalar::kFloat:
        return double(as<float>());
      case Scalar::kDouble:
        return as<double>();
      }
      return 0;
    }
  };

  Value read(Scalar type) { return m_format == Format::kText ? readText(type) : readBinary(type); }
  Value readBinary(Scalar type) {
    static_assert(std::endian::native == std::endian::little);
    std::size_t const size = sizeOf(type);
    if (left() < size) failTruncated();
    Value value{type, {}};
    std::memcpy(value.bytes, m_next, size);
    if (m_format == Format::kBig) std::reverse(value.bytes, value.bytes + size);
    m_next += size;
    return value;
  }
  Value readText(Scalar type) {
    auto const isSpace = [](char c) { return c == ' ' || (c >= '\t' && c <= '\r'); };
    m_next = std::find_if_not(m_next, m_end, isSpace);
    if (m_next == m_end) failTruncated();
    char const* const end = std::find_if(m_next, m_end, isSpace);
    char const* const begin = m_next + (*m_next == '+' && end - m_next > 1 ? 1 : 0);
    m_next = end;
    double number = 0;
    auto const parsed = std::from_chars(begin, end, number);
    if (parsed.ptr != end || (parsed.ec != std::errc() && parsed.ec != std::errc::result_out_of_range))
      fail("has a value that is no number: '" + oneLine(std::string(begin, end), 40) + "'");
    Value value{type, {}};
    auto const store = [&](auto v) { std::memcpy(value.bytes, &v, sizeof v); };
    auto const storeWhole = [&](auto v) {
      using T = decltype(v);
      if (!(number >= double(std::numeric_limits<T>::min()) &&
            number <= double(std::numeric_limits<T>::max())) ||
          number != std::floor(number))
        fail("has a value that its type does not hold: '" + oneLine(std::string(begin, end), 40) + "'");
      store(static_cast<T>(number));
    };
    switch (type) {
    case Scalar::kInt8:
      storeWhole(std::int8_t());
      break;
    case Scalar::kUint8:
      storeWhole(std::uint8_t());
      break;
    case Scalar::kInt16:
      storeWhole(std::int16_t());
      break;
    case Scalar::kUint16:
      storeWhole(std::uint16_t());
      break;
    case Scalar::kInt32:
      storeWhole(std::int32_t());
      break;
    case Scalar::kUint32:
      storeWhole(std::uint32_t());
      break;
    case Scalar::kFloat: {
      // Parsed as a float: rounding twice would not always give the nearest one.
      float v = 0;
      auto const f = std::from_chars(begin, end, v);
      if (f.ec == std::errc::result_out_of_range)
        v = std::abs(number) < 1
                ? 0.0f
                : std::copysign(std::numeric_limits<float>::infinity(), static_cast<float>(number));
      store(v);
      break;
    }
    case Scalar::kDouble:
      store(number);
      break;
    }
    return value;
  }
  void skipList(Property const& property) {
    double const count = read(property.countType).number();
    if (!(count >= 0 && count == std::floor(count))) fail("has a list of a bad length");
    if (count > double(left())) failTruncated();
    if (m_format == Format::kText) {
      for (auto rest = static_cast<std::size_t>(count); rest > 0; --rest) read(property.type);
      return;
    }
    if (count * double(sizeOf(property.type)) > double(left())) failTruncated();
    m_next += static_cast<std::size_t>(count) * sizeOf(property.type);
  }
  /// A count that the rest of the file cannot hold is refused before anything is allocated for it.
  void checkCount(Element const& element) const {
    std::uint64_t least = 0;
    for (Property const& p : element.properties)
      least += m_format == Format::kText ? 2 : sizeOf(p.isList ? p.countType : p.type);
    // The last value of a text may lack its blank.
    if (element.count > 0 && (least == 0 || element.count > (left() + 1) / least)) {
      if (least == 0) fail("has an element without properties: '" + oneLine(element.name, 40) + "'");
      failTruncated();
    }
  }
  void skip(Element const& element) {
    checkCount(element);
    for (std::uint64_t n = 0; n < element.count; ++n) {
      for (Property const& p : element.properties) {
        if (p.isList)
          skipList(p);
        else
          read(p.type);
      }
    }
  }

  // --- Points

  void readVertices(Element const& element) {
    std::array<int, 3> axes{-1, -1, -1};
    for (std::size_t n = 0; n < element.properties.size(); ++n) {
      for (std::size_t a = 0; a < 3; ++a) {
        if (!element.properties[n].isList && element.properties[n].name == std::string(1, "xyz"[a]))
          axes[a] = static_cast<int>(n);
      }
    }
    for (std::size_t a = 0; a < 3; ++a) {
      if (axes[a] < 0) fail(std::string("has vertices without '") + "xyz"[a] + "'");
      m_points.doublePositions |=
          element.properties[static_cast<std::size_t>(axes[a])].type == Scalar::kDouble;
    }
    checkCount(element);
    auto const count = static_cast<std::size_t>(element.count);
    m_world.reserve(count);
    std::vector<int> attributeOf(element.properties.size(), -1);
    for (std::size_t n = 0; n < element.properties.size(); ++n) {
      Property const& p = element.properties[n];
      if (p.isList || std::find(axes.begin(), axes.end(), static_cast<int>(n)) != axes.end()) continue;
      static constexpr char const* kTypes[] = {"int8",  "uint8",  "int16", "uint16",
                                               "int32", "uint32", "float", "double"};
      attributeOf[n] = static_cast<int>(m_points.attributes.size());
      m_points.attributes.push_back({p.name, kTypes[static_cast<std::size_t>(p.type)], sizeOf(p.type), {}});
      m_points.attributes.back().bytes.reserve(count * sizeOf(p.type));
    }
    for (std::size_t point = 0; point < count; ++point) {
      double3 world{0, 0, 0};
      for (std::size_t n = 0; n < element.properties.size(); ++n) {
        Property const& p = element.properties[n];
        if (p.isList) {
          skipList(p);
          continue;
        }
        Value const value = read(p.type);
        if (attributeOf[n] < 0) {
          auto const axis = std::find(axes.begin(), axes.end(), static_cast<int>(n)) - axes.begin();
          world[static_cast<int>(axis)] = value.number();
        } else {
          auto& bytes = m_points.attributes[static_cast<std::size_t>(attributeOf[n])].bytes;
          bytes.insert(bytes.end(), value.bytes, value.bytes + sizeOf(p.type));
        }
      }
      m_world.push_back(world);
    }
  }

  /// Behind the vertices, as all writers have them.
  void readFaces(Element const& element, Mesh& mesh) {
    std::size_t indices = element.properties.size();
    for (std::size_t n = 0; n < element.properties.size(); ++n) {
      Property const& p = element.properties[n];
      if (p.isList && (p.name == "vertex_indices" || p.name == "vertex_index")) indices = n;
    }
    if (indices == element.properties.size()) fail("has faces without 'vertex_indices'");
    checkCount(element);
    std::vector<std::uint32_t> face;
    for (std::uint64_t n = 0; n < element.count; ++n)
      for (std::size_t k = 0; k < element.properties.size(); ++k) {
        Property const& p = element.properties[k];
        if (k == indices)
          readFace(p, face, mesh);
        else if (p.isList)
          skipList(p);
        else
          read(p.type);
      }
  }
  void readFace(Property const& property, std::vector<std::uint32_t>& face, Mesh& mesh) {
    double const count = read(property.countType).number();
    if (!(count >= 3 && count == std::floor(count))) fail("has a face of fewer than three vertices");
    if (count > double(left())) failTruncated();
    face.clear();
    for (auto rest = static_cast<std::size_t>(count); rest > 0; --rest) {
      double const vertex = read(property.type).number();
      if (!(vertex >= 0 && vertex < double(m_world.size()) && vertex == std::floor(vertex)))
        fail("has a face of a vertex that is not there");
      face.push_back(static_cast<std::uint32_t>(vertex));
    }
    for (std::size_t n = 2; n < face.size(); ++n) mesh.triangles.push_back({face[0], face[n - 1], face[n]});
  }

  /// From world to tile space. Float positions keep the origin, so that a power of two scales them exactly.
  PointSet place(PlyOptions const& options) {
    m_points.voxelSize =
        options.voxelSize > 0 ? options.voxelSize : chooseVoxelSize(m_world, options.pointsPerTile);
    double const s = 1 / m_points.voxelSize;
    if (m_points.doublePositions) {
      auto const [low, high] = Extent(m_world);
      for (int a = 0; a < 3; ++a) {
        // A multiple of the tile's width keeps the tiles where they would be.
        double const step = 4 * m_points.voxelSize;
        if (low[a] <= high[a]) m_points.origin[a] = std::floor((low[a] / 2 + high[a] / 2) / step) * step;
        if (!std::isfinite(m_points.origin[a])) m_points.origin[a] = 0;
      }
    }
    m_points.positions.reserve(m_world.size());
    for (double3 const& p : m_world) {
      double3 const q = (p - m_points.origin) * s;
      m_points.positions.push_back(
          {static_cast<float>(q.x), static_cast<float>(q.y), static_cast<float>(q.z)});
    }
    return std::move(m_points);
  }

  std::string const& m_path;
  char const* m_next;
  char const* m_end;
  std::size_t m_headerBytes = 0;
  Format m_format = Format::kText;
  std::vector<Element> m_elements;
  std::vector<double3> m_world;
  PointSet m_points;
};

} // namespace

double chooseVoxelSize(std::vector<double3> const& world, double pointsPerTile) {
  // Of a large cloud every n-th point, with a share of the points: tiles that hold many stay full.
  auto const [low, high] = Extent(world);
  std::vector<double3> finite;
  std::copy_if(world.begin(), world.end(), std::back_inserter(finite), isFinite);
  if (finite.empty()) return 1;
  double extent = 0, largest = 0;
  for (int a = 0; a < 3; ++a) {
    extent = std::max(extent, high[a] - low[a]);
    largest = std::max({largest, std::abs(low[a]), std::abs(high[a])});
  }
  if (!(extent > 0)) return 1;
  extent = std::min(extent, 0x1p1000); // finite, also as a power of two
  auto const occupied = [&](double voxelSize) {
    double const s = 0.25 / voxelSize;
    std::vector<std::array<double, 3>> tiles;
    tiles.reserve(finite.size());
    for (double3 const& p : finite)
      tiles.push_back({std::floor(p.x * s), std::floor(p.y * s), std::floor(p.z * s)});
    std::sort(tiles.begin(), tiles.end());
    return double(std::unique(tiles.begin(), tiles.end()) - tiles.begin());
  };
  // Finer by halves, until a tile holds fewer points than wanted; then whichever side comes nearer. Not finer
  // than what a float resolves, nor so fine that the cloud leaves the tree's reach.
  // Nor so fine that its inverse is infinite.
  constexpr double kSmallest = 0x1p-1000;
  double const finest = std::max(std::max(extent, largest) * 0x1p-22, kSmallest);
  double size = std::exp2(std::ceil(std::log2(std::max(extent, kSmallest)))), before = 0;
  auto const n = double(finite.size());
  for (;;) {
    double const held = n / occupied(size);
    if (held <= pointsPerTile) {
      bool const coarserIsNearer = before > 0 && before / pointsPerTile < pointsPerTile / held;
      return coarserIsNearer ? 2 * size : size;
    }
    if (size / 2 < finest) return size;
    before = held;
    size /= 2;
  }
}

PointSet parsePly(std::string const& path, char const* data, std::size_t size, PlyOptions const& options) {
  return Parser(path, data, size).run(options);
}

void parsePlyMesh(std::string const& path, char const* data, std::size_t size, Mesh& mesh) {
  Parser(path, data, size).runMesh(mesh);
}

PointSet readPly(std::string const& path, PlyOptions const& options) {
  std::string const content = regularFileContent(path);
  return parsePly(path, content.data(), content.size(), options);
}

} // namespace VLN::Interop
