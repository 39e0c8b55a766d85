#include "Interop/FileError.h"
#include "Interop/FileFormat.h"
#include "Interop/Mesh.h"
#include "Interop/PlyMeshImpl.h"
#include "Interop/RegularFileImpl.h"

#include <algorithm>
#include <charconv>
#include <cmath>
#include <cstring>
#include <fstream>

namespace VLN::Interop {

namespace {

using Velorn::Math::double3;

bool isBlank(char c) { return c == ' ' || c == '\t' || c == '\r'; }

/// The words of a text, line by line.
class Lines {
public:
  Lines(std::string const& path, std::string const& text)
      : m_path(path)
      , m_next(text.data())
      , m_end(text.data() + text.size()) {}

  bool nextLine() {
    m_next = m_lineEnd ? m_lineEnd + 1 : m_next;
    if (m_next >= m_end) return false;
    m_lineEnd = std::find(m_next, m_end, '\n');
    ++m_line;
    return true;
  }
  /// Empty at the end of the line.
  std::string_view word() {
    m_next = std::find_if_not(m_next, m_lineEnd, isBlank);
    char const* const begin = m_next;
    m_next = std::find_if(m_next, m_lineEnd, isBlank);
    return {begin, static_cast<std::size_t>(m_next - begin)};
  }
  [[noreturn]] void fail(std::string const& what) const {
    throw FileError(m_path, "line " + std::to_string(m_line) + ": " + what);
  }
  double number() {
    std::string_view text = word();
    if (text.size() > 1 && text[0] == '+') text.remove_prefix(1);
    double value = 0;
    auto const parsed = std::from_chars(text.data(), text.data() + text.size(), value);
    if (text.empty() || parsed.ec != std::errc() || parsed.ptr != text.data() + text.size())
      fail("'" + oneLine(std::string(text), 40) + "' is no coordinate");
    return value;
  }
  double3 point() {
    double3 p;
    for (int a = 0; a < 3; ++a) p[a] = number();
    return p;
  }

private:
  std::string const& m_path;
  char const *m_next, *m_end, *m_lineEnd = nullptr;
  std::int64_t m_line = 0;
};

void parseObj(std::string const& path, std::string const& text, Mesh& mesh) {
  Lines lines(path, text);
  std::vector<std::uint32_t> face;
  while (lines.nextLine()) {
    auto const kind = lines.word();
    if (kind == "v") mesh.points.push_back(lines.point());
    if (kind != "f") continue;
    face.clear();
    for (auto word = lines.word(); !word.empty(); word = lines.word()) {
      std::int64_t n = 0;
      auto const parsed = std::from_chars(word.data(), word.data() + word.size(), n);
      bool const ends = parsed.ptr == word.data() + word.size() || *parsed.ptr == '/';
      auto const count = static_cast<std::int64_t>(mesh.points.size());
      if (n < 0) n += count + 1; // counted from the last one
      if (parsed.ec != std::errc() || !ends || n < 1 || n > count)
        lines.fail("a face of the vertex '" + oneLine(std::string(word), 40) + "', and there are " +
                   std::to_string(count));
      face.push_back(static_cast<std::uint32_t>(n - 1));
    }
    if (face.size() < 3) lines.fail("a face of fewer than three vertices");
    for (std::size_t n = 2; n < face.size(); ++n) mesh.triangles.push_back({face[0], face[n - 1], face[n]});
  }
}

void parseStlText(std::string const& path, std::string const& text, Mesh& mesh) {
  Lines lines(path, text);
  while (lines.nextLine())
    if (lines.word() == "vertex") mesh.points.push_back(lines.point());
  if (mesh.points.size() % 3 != 0)
    throw FileError(path, "is truncated: its last triangle has no three corners");
}

void parseStl(std::string const& path, std::string const& bytes, Mesh& mesh) {
  constexpr std::size_t kHead = 84, kTriangle = 50;
  std::uint32_t count = 0;
  if (bytes.size() >= kHead) std::memcpy(&count, bytes.data() + 80, sizeof count);
  bool const binary = bytes.size() >= kHead && bytes.size() - kHead == count * kTriangle;
  // Many binary files begin with that word too: their length tells, and what a damaged one lacks.
  if (!binary && bytes.compare(0, 5, "solid") == 0 &&
      (bytes.find("facet") != std::string::npos || bytes.find("endsolid") != std::string::npos))
    parseStlText(path, bytes, mesh);
  else if (!binary)
    throw FileError(path, bytes.size() < kHead ? "is not an .stl file"
                                               : "is truncated or damaged: it announces " +
                                                     std::to_string(count) + " triangles");
  else
    for (std::size_t n = 0; n < count; ++n)
      for (std::size_t corner = 0; corner < 3; ++corner) {
        float p[3];
        std::memcpy(p, bytes.data() + kHead + n * kTriangle + 12 + corner * sizeof p, sizeof p);
        mesh.points.push_back({double(p[0]), double(p[1]), double(p[2])});
      }
  for (std::uint32_t n = 0; n + 2 < mesh.points.size(); n += 3) mesh.triangles.push_back({n, n + 1, n + 2});
}

std::string contentOf(std::string const& path) {
  std::string content = regularFileContent(path);
  if (content.empty()) throw FileError(path, "is empty");
  return content;
}

} // namespace

bool isMeshFile(std::string const& path) {
  FileFormat const format = formatOf(path);
  if (format == FileFormat::kObj || format == FileFormat::kStl) return true;
  if (format != FileFormat::kPly) return false;
  std::ifstream in(path, std::ios::binary);
  std::string head(1 << 16, '\0');
  in.read(head.data(), static_cast<std::streamsize>(head.size()));
  head.resize(in.gcount());
  head.resize(std::min(head.find("end_header"), head.size()));
  auto const faces = head.find("\nelement face ");
  if (faces == std::string::npos) return false;
  auto const count = head.find_first_not_of(' ', faces + 14);
  return count != std::string::npos && head[count] != '0';
}

Mesh readMesh(std::string const& path) {
  std::string const content = contentOf(path);
  Mesh mesh;
  switch (formatOf(path)) {
  case FileFormat::kObj:
    parseObj(path, content, mesh);
    break;
  case FileFormat::kStl:
    parseStl(path, content, mesh);
    break;
  default:
    parsePlyMesh(path, content.data(), content.size(), mesh);
  }
  for (double3 const& p : mesh.points)
    if (!std::isfinite(p.x) || !std::isfinite(p.y) || !std::isfinite(p.z))
      throw FileError(path, "has a vertex whose position is no number");
  if (mesh.triangles.empty()) throw FileError(path, "has no face");
  return mesh;
}

} // namespace VLN::Interop
