// An image of VTK is XML, and numbers in one of four ways:
//
//   format="ascii"      text between the tags
//   format="binary"     base64 between the tags
//   format="appended"   at an offset behind the '_' of <AppendedData>, as base64 or raw bytes
//
// Bytes begin with their number. Where a compressor is named they are packed in blocks instead: the number of
// blocks, the size of one and of the last (0: as the others), the packed size of each; then, in base64 as a
// text of its own, the blocks.
#include "Interop/ArrayFiles.h"

#include "Interop/ArrayGridImpl.h"
#include "Interop/FileFormat.h"
#include "Interop/GuardedReadImpl.h"
#include "Interop/RegularFileImpl.h"
#include "Interop/VdbImportImpl.h"

#include <algorithm>
#include <array>
#include <charconv>
#include <cmath>
#include <cstring>
#include <fstream>
#include <map>
#include <memory>
#include <optional>
#include <vector>

#include <zlib.h>

namespace VLN::Interop {

namespace {

using openvdb::Coord;

[[noreturn]] void damaged(std::string const& what) {
  throw UnreadableArrays("is truncated or damaged: " + what);
}

bool isSpace(char c) { return c == ' ' || c == '\n' || c == '\t' || c == '\r'; }

struct Tag {
  std::string_view name; ///< "/Piece" for an end
  std::string_view attributes;
  std::size_t end = 0; ///< behind it, in the file
  bool closed = false; ///< "<.../>"

  std::string get(std::string_view key) const {
    for (std::size_t at = 0; (at = attributes.find(key, at)) != std::string_view::npos; at += key.size()) {
      if (at > 0 && !isSpace(attributes[at - 1])) continue;
      std::size_t from = at + key.size();
      while (from < attributes.size() && isSpace(attributes[from])) ++from;
      if (from >= attributes.size() || attributes[from] != '=') continue;
      ++from;
      while (from < attributes.size() && isSpace(attributes[from])) ++from;
      if (from >= attributes.size() || (attributes[from] != '"' && attributes[from] != '\'')) continue;
      auto const last = attributes.find(attributes[from], from + 1);
      if (last != std::string_view::npos) return std::string(attributes.substr(from + 1, last - from - 1));
    }
    return "";
  }
};

std::string unescaped(std::string text) {
  static constexpr std::pair<std::string_view, char> kNames[] = {
      {"&lt;", '<'}, {"&gt;", '>'}, {"&quot;", '"'}, {"&apos;", '\''}, {"&amp;", '&'}};
  for (auto const& [name, c] : kNames)
    for (std::size_t at = 0; (at = text.find(name, at)) != std::string::npos; ++at)
      text.replace(at, name.size(), 1, c);
  return text;
}

template <class T> std::vector<T> numbersOf(std::string_view text, std::size_t most) {
  std::vector<T> list;
  for (char const *p = text.data(), *end = p + text.size(); list.size() < most;) {
    while (p < end && isSpace(*p)) ++p;
    if (p == end) break;
    if (*p == '+') ++p;
    T value{};
    auto const parsed = std::from_chars(p, end, value);
    if (parsed.ec != std::errc() || (parsed.ptr < end && !isSpace(*parsed.ptr)))
      damaged("'" + oneLine(std::string(p, std::min(p + 20, end)), 20) + "' is no number");
    list.push_back(value);
    p = parsed.ptr;
  }
  return list;
}

NumberType typeNamed(std::string const& name) {
  static std::map<std::string, NumberType> const types = {
      {"Int8", {'i', 1}},    {"UInt8", {'u', 1}},  {"Int16", {'i', 2}}, {"UInt16", {'u', 2}},
      {"Int32", {'i', 4}},   {"UInt32", {'u', 4}}, {"Int64", {'i', 8}}, {"UInt64", {'u', 8}},
      {"Float32", {'f', 4}}, {"Float64", {'f', 8}}};
  auto const found = types.find(name);
  return found == types.end() ? NumberType{'?', 0} : found->second;
}

/// The bytes of base64 text, whose blanks are left out, up to its end by '=' or another character.
class Base64 {
public:
  explicit Base64(std::string_view text)
      : m_text(text) {}
  /// The next bytes; further ones of the last group of four characters are dropped when `last`.
  std::string take(std::uint64_t count, bool last) {
    std::string bytes;
    while (bytes.size() + m_left.size() < count) {
      bytes += m_left;
      m_left = group();
      if (m_left.empty()) damaged("numbers are missing");
    }
    std::size_t const more = static_cast<std::size_t>(count) - bytes.size();
    bytes += m_left.substr(0, more);
    m_left.erase(0, last ? m_left.size() : more);
    return bytes;
  }

private:
  std::string group() {
    unsigned bits = 0, count = 0, padding = 0;
    while (count < 4 && m_at < m_text.size()) {
      char const c = m_text[m_at];
      int const v = c >= 'A' && c <= 'Z'   ? c - 'A'
                    : c >= 'a' && c <= 'z' ? c - 'a' + 26
                    : c >= '0' && c <= '9' ? c - '0' + 52
                    : c == '+'             ? 62
                    : c == '/'             ? 63
                    : c == '='             ? 0
                                           : -1;
      if (v < 0 && !isSpace(c)) break;
      ++m_at;
      if (v < 0) continue;
      padding += c == '=';
      bits = bits << 6 | unsigned(v);
      ++count;
    }
    if (count < 4 || padding > 2) return "";
    std::string bytes;
    for (unsigned n = 0; n < 3 - padding; ++n) bytes += static_cast<char>(bits >> (16 - 8 * n) & 255);
    return bytes;
  }

  std::string_view m_text;
  std::size_t m_at = 0;
  std::string m_left;
};

/// The same of bytes that stand there as they are.
class Raw {
public:
  explicit Raw(std::string_view text)
      : m_text(text) {}
  std::string take(std::uint64_t count, bool) {
    if (count > m_text.size() - m_at) damaged("numbers are missing");
    m_at += static_cast<std::size_t>(count);
    return std::string(
        m_text.substr(m_at - static_cast<std::size_t>(count), static_cast<std::size_t>(count)));
  }

private:
  std::string_view m_text;
  std::size_t m_at = 0;
};

class VtiReader {
public:
  explicit VtiReader(std::string const& path)
      : m_bytes(regularFileContent(path))
      , m_text(m_bytes) {
    m_file.path = path;
  }

  VdbFile run() {
    openvdb::initialize();
    auto const appended = m_text.find("<AppendedData");
    auto const xml = m_text.substr(0, appended);
    if (appended != std::string_view::npos) {
      auto const head = m_text.find('>', appended), begin = m_text.find('_', head);
      if (head == std::string_view::npos || begin == std::string_view::npos)
        damaged("its appended data does not begin");
      m_rawAppended = m_text.substr(appended, head - appended).find("base64") == std::string_view::npos;
      m_appended = m_text.substr(begin + 1);
    }
    for (std::size_t at = 0; auto const tag = next(xml, at);) take(*tag, xml, at);
    if (!m_seen) throw UnreadableArrays("is no image of VTK");
    for (auto const& made : m_made) {
      made.grid->grid()->setName(made.name);
      made.grid->grid()->setTransform(m_transform[made.cells]);
      m_file.grids.push_back(made.grid->grid());
    }
    return std::move(m_file);
  }

private:
  enum class Place { kNone, kField, kPoints, kCells };

  static std::optional<Tag> next(std::string_view xml, std::size_t& at) {
    for (;;) {
      auto const begin = xml.find('<', at);
      if (begin == std::string_view::npos) return {};
      if (xml.substr(begin, 4) == "<!--") {
        at = xml.find("-->", begin);
        if (at == std::string_view::npos) return {};
        continue;
      }
      auto end = begin + 1;
      for (char quote = 0; end < xml.size() && (quote || xml[end] != '>'); ++end)
        if (quote ? xml[end] == quote : xml[end] == '"' || xml[end] == '\'')
          quote = quote ? char(0) : xml[end];
      if (end >= xml.size()) damaged("a tag does not end");
      auto text = xml.substr(begin + 1, end - begin - 1);
      at = end + 1;
      Tag tag;
      tag.end = at;
      tag.closed = text.ends_with('/');
      auto const split =
          static_cast<std::size_t>(std::find_if(text.begin(), text.end(), isSpace) - text.begin());
      tag.name = text.substr(0, split);
      if (tag.closed && tag.name.ends_with('/')) tag.name.remove_suffix(1);
      tag.attributes = text.substr(split);
      return tag;
    }
  }

  void take(Tag const& tag, std::string_view xml, std::size_t& at) {
    if (tag.name == "VTKFile") {
      if (tag.get("type") != "ImageData")
        throw UnreadableArrays("is a file of VTK of type '" + oneLine(tag.get("type"), 40) +
                               "', and ImageData is read");
      m_bigEndian = tag.get("byte_order") == "BigEndian";
      m_headerBytes = tag.get("header_type") == "UInt64" ? 8 : 4;
      m_compressor = tag.get("compressor");
      if (!m_compressor.empty() && m_compressor != "vtkZLibDataCompressor")
        throw UnreadableArrays("is packed with " + oneLine(m_compressor, 40) +
                               ", and vtkZLibDataCompressor is read");
    } else if (tag.name == "ImageData") {
      readImage(tag);
    } else if (tag.name == "Piece") {
      m_piece = extentOf(tag.get("Extent"));
    } else if (tag.name == "PointData" || tag.name == "CellData" || tag.name == "FieldData") {
      m_place = tag.closed           ? Place::kNone
                : tag.name[0] == 'P' ? Place::kPoints
                : tag.name[0] == 'C' ? Place::kCells
                                     : Place::kField;
    } else if (tag.name == "/PointData" || tag.name == "/CellData" || tag.name == "/FieldData") {
      m_place = Place::kNone;
    } else if (tag.name == "DataArray" && m_place != Place::kNone) {
      if (!m_seen) throw UnreadableArrays("is no image of VTK");
      std::string_view inside;
      if (!tag.closed) {
        auto const end = xml.find('<', tag.end);
        if (end == std::string_view::npos) damaged("an array does not end");
        inside = xml.substr(tag.end, end - tag.end);
        at = end;
      }
      readArray(tag, inside);
    }
  }

  using Extent = std::array<std::int64_t, 6>;
  static Extent extentOf(std::string const& text) {
    auto const list = numbersOf<std::int64_t>(text, 7);
    if (list.size() != 6) damaged("an extent is none");
    Extent extent{};
    for (std::size_t n = 0; n < 6; ++n) {
      checkIndex(double(list[n]));
      extent[n] = list[n];
    }
    return extent;
  }

  void readImage(Tag const& tag) {
    m_seen = true;
    m_piece = extentOf(tag.get("WholeExtent"));
    auto const three = [&](char const* key, std::vector<double> const& otherwise) {
      std::string const text = tag.get(key);
      auto list = text.empty() ? otherwise : numbersOf<double>(text, 10);
      if (list.size() != otherwise.size()) damaged(std::string("the attribute ") + key + " is none");
      return list;
    };
    auto const origin = three("Origin", {0, 0, 0}), spacing = three("Spacing", {1, 1, 1}),
               turned = three("Direction", {1, 0, 0, 0, 1, 0, 0, 0, 1});
    for (bool const cells : {false, true}) {
      double rows[3][4];
      for (std::size_t row = 0; row < 3; ++row) {
        rows[row][3] = origin[row];
        for (std::size_t a = 0; a < 3; ++a) {
          rows[row][a] = turned[3 * row + a] * spacing[a];
          if (cells) rows[row][3] += rows[row][a] / 2; // their middles
        }
      }
      m_transform[cells] = transformOfRows(rows);
    }
  }

  std::uint64_t header(std::string const& bytes, std::size_t n) const {
    NumberType const type{'u', m_headerBytes, m_bigEndian};
    auto const value =
        wholeOf(reinterpret_cast<std::byte const*>(bytes.data()) + n * std::size_t(m_headerBytes), type);
    return static_cast<std::uint64_t>(value);
  }

  /// All bytes of an array, of which there must be as many as wanted.
  template <class Source>
  std::string bytesOf(Source source, std::string_view rest, bool text, std::uint64_t wanted) {
    auto const word = std::uint64_t(m_headerBytes);
    if (m_compressor.empty()) {
      if (header(source.take(word, false), 0) != wanted)
        damaged("an array is not as long as its extent says");
      return source.take(wanted, true);
    }
    std::string head = source.take(3 * word, false);
    std::uint64_t const blocks = header(head, 0), size = header(head, 1), last = header(head, 2);
    if (blocks > rest.size() / word || (blocks == 0) != (wanted == 0))
      damaged("an array has no blocks, or too many");
    if (blocks == 0) return "";
    if (size > wanted || last > size || double(size) * double(blocks) > double(wanted) + double(size) ||
        size * (blocks - 1) + (last ? last : size) != wanted)
      damaged("an array is not as long as its extent says");
    std::string const sizes = source.take(blocks * word, true);
    if (text) source = Source(rest.substr(encodedSize(rest, (3 + blocks) * word)));
    std::string bytes;
    for (std::uint64_t n = 0; n < blocks; ++n) {
      std::string const packed = source.take(header(sizes, n), n + 1 == blocks);
      std::uint64_t const full = n + 1 == blocks && last ? last : size;
      uLongf got = full;
      std::size_t const at = bytes.size();
      bytes.resize(at + full);
      if (uncompress(reinterpret_cast<Bytef*>(&bytes[at]), &got,
                     reinterpret_cast<Bytef const*>(packed.data()), packed.size()) != Z_OK ||
          got != full)
        damaged("a block of an array cannot be unpacked");
    }
    return bytes;
  }
  /// How many characters of a text so many bytes take, with blanks before them.
  static std::size_t encodedSize(std::string_view text, std::uint64_t bytes) {
    std::size_t at = 0;
    for (std::uint64_t left = (bytes + 2) / 3 * 4; left > 0 && at < text.size(); ++at)
      left -= !isSpace(text[at]);
    return at;
  }

  static std::string numbersAsBytes(std::string_view text, NumberType const& type, std::uint64_t count) {
    std::string bytes;
    auto const put = [&](auto const& list) {
      if (list.size() != count) damaged("an array is not as long as its extent says");
      bytes.assign(reinterpret_cast<char const*>(list.data()), list.size() * sizeof list[0]);
    };
    auto const most = static_cast<std::size_t>(count) + 1;
    if (type.kind == 'f' && type.bytes == 4)
      put(numbersOf<float>(text, most));
    else if (type.kind == 'f')
      put(numbersOf<double>(text, most));
    else if (type.kind == 'u' && type.bytes == 8)
      put(numbersOf<std::uint64_t>(text, most));
    else {
      auto const list = numbersOf<std::int64_t>(text, most);
      // What the type has no room for.
      int const bits = 8 * type.bytes - (type.kind == 'i');
      for (auto const v : list)
        if (bits < 63 &&
            (v >= std::int64_t(1) << bits || v < (type.kind == 'i' ? -(std::int64_t(1) << bits) : 0)))
          damaged("a number does not fit into its type");
      put(list);
    }
    return bytes;
  }

  void readArray(Tag const& tag, std::string_view inside) {
    std::string const found = unescaped(tag.get("Name")), name = found.empty() ? "unnamed" : found;
    NumberType type = typeNamed(tag.get("type"));
    std::string const componentsText = tag.get("NumberOfComponents");
    auto const list =
        componentsText.empty() ? std::vector<std::int64_t>{1} : numbersOf<std::int64_t>(componentsText, 2);
    std::int64_t const components = list.size() == 1 ? list[0] : 0;
    type.bigEndian = m_bigEndian;
    bool const cells = m_place == Place::kCells, field = m_place == Place::kField;
    if (field && !name.ends_with(kBackground)) return;
    auto grid =
        type.bytes && components > 0 && components < 10 ? ArrayGrid::of(type, int(components)) : nullptr;
    if (!grid) {
      if (field) return;
      m_file.skipped.push_back({name, "arrays of " + oneLine(tag.get("type"), 20) + " with " +
                                          oneLine(componentsText.empty() ? "1" : componentsText, 10) +
                                          " components are not read"});
      return;
    }
    ArrayLayout layout;
    double samples = 1;
    for (std::size_t a = 0; a < 3; ++a) {
      layout.count[a] =
          field ? 1 : std::max<std::int64_t>(m_piece[2 * a + 1] - m_piece[2 * a] + (cells ? 0 : 1), 0);
      samples *= double(layout.count[a]);
    }
    double const size = samples * double(components * type.bytes);
    if (size > 1e15) damaged("an array is not as long as its extent says");
    auto const wanted = static_cast<std::uint64_t>(size);
    std::string const format = tag.get("format");
    std::string bytes;
    if (format == "appended") {
      auto const offset = numbersOf<std::uint64_t>(tag.get("offset"), 2);
      if (offset.size() != 1 || offset[0] > m_appended.size()) damaged("an array lies behind the end");
      auto const rest = m_appended.substr(offset[0]);
      bytes =
          m_rawAppended ? bytesOf(Raw(rest), rest, false, wanted) : bytesOf(Base64(rest), rest, true, wanted);
    } else if (format == "binary") {
      bytes = bytesOf(Base64(inside), inside, true, wanted);
    } else if (format == "ascii" || format.empty()) {
      if (samples * double(components) > 2 * double(inside.size()) + 2)
        damaged("an array is not as long as its extent says");
      bytes = numbersAsBytes(inside, type, static_cast<std::uint64_t>(samples) * std::uint64_t(components));
      if (type.kind != 'f') type = {type.kind == 'u' && type.bytes == 8 ? 'u' : 'i', 8};
      type.bigEndian = false;
    } else
      damaged("the format of an array is none");
    auto const* const values = reinterpret_cast<std::byte const*>(bytes.data());
    if (field) {
      m_backgrounds[name.substr(0, name.size() - kBackground.size())] = {type, int(components),
                                                                         std::move(bytes)};
      return;
    }
    layout.componentStride = type.bytes;
    std::int64_t stride = type.bytes * components;
    for (std::size_t a = 0; a < 3; ++a) {
      layout.stride[a] = stride;
      stride *= layout.count[a];
    }
    gridFor(name, cells, std::move(grid), int(components))
        .setBox(values, type, layout, Coord(int(m_piece[0]), int(m_piece[2]), int(m_piece[4])));
  }

  /// The grid of that name, which an earlier piece may have made.
  ArrayGrid& gridFor(std::string const& name, bool cells, std::unique_ptr<ArrayGrid> grid, int components) {
    for (auto const& made : m_made) {
      if (made.name != name || made.cells != cells) continue;
      if (made.grid->grid()->type() != grid->grid()->type()) damaged("an array has two types");
      return *made.grid;
    }
    auto const background = m_backgrounds.find(name);
    if (background != m_backgrounds.end() && background->second.components == components)
      grid->setBackground(reinterpret_cast<std::byte const*>(background->second.bytes.data()),
                          background->second.type);
    m_made.push_back({name, cells, std::move(grid)});
    return *m_made.back().grid;
  }

  static constexpr std::string_view kBackground = ".background";
  struct Background {
    NumberType type;
    int components;
    std::string bytes;
  };

  std::string m_bytes;
  std::string_view m_text, m_appended;
  bool m_rawAppended = true, m_seen = false, m_bigEndian = false;
  int m_headerBytes = 4;
  std::string m_compressor;
  Place m_place = Place::kNone;
  Extent m_piece{};
  openvdb::math::Transform::Ptr m_transform[2]; ///< of points, and of cells
  struct Made {
    std::string name;
    bool cells;
    std::unique_ptr<ArrayGrid> grid;
  };
  std::vector<Made> m_made; ///< in the order of the file
  std::map<std::string, Background> m_backgrounds;
  VdbFile m_file;
};

} // namespace

bool isVtiFile(std::string const& path) {
  if (formatOf(path) == FileFormat::kVti) return true;
  char head[256] = {};
  std::ifstream in(path, std::ios::binary);
  in.read(head, sizeof head);
  return std::string_view(head, static_cast<std::size_t>(in.gcount())).find("<VTKFile") !=
         std::string_view::npos;
}

VdbImport importVti(std::string const& path, VdbReadLimits const& asked, Progress const& progress) {
  if (progress) progress("reading", 0);
  openvdb::initialize();
  VdbFile file = readGuarded(path, asked, regularFileSize(path), [&] { return VtiReader(path).run(); });
  return importGrids(file, asked, progress);
}

} // namespace VLN::Interop
