// ObjText: lines of a Wavefront OBJ file that draw boxes.
//
//        7-------8        k
//       /|      /|        |  j
//      5-------6 |        | /
//      | 3-----|-4        |/
//      |/      |/         +---- i
//      1-------2
#pragma once

#include "Velorn/Math.h"

#include <charconv>
#include <cstdint>
#include <string>

namespace VLN::Internal {

/// Collects text and hands it to a stream in large pieces. Numbers are written so that they read back as they
/// were, whatever the locale.
template <class Stream> class ObjText {
public:
  explicit ObjText(Stream& out)
      : m_out(out) {
    m_text.reserve(kFlushAt + 1024);
  }
  ~ObjText() { flush(); }
  ObjText(ObjText const&) = delete;
  ObjText& operator=(ObjText const&) = delete;

  void line(char const* text) {
    m_text += text;
    m_text += '\n';
    if (m_text.size() >= kFlushAt) flush();
  }
  /// The eight corners, i fastest.
  void boxVertices(Velorn::Math::float3 const& low, Velorn::Math::float3 const& high) {
    for (int corner = 0; corner < 8; ++corner) {
      m_text += 'v';
      number(corner & 1 ? high.x : low.x);
      number(corner & 2 ? high.y : low.y);
      number(corner & 4 ? high.z : low.z);
      line("");
    }
  }
  /// The six faces of the box whose first vertex is `base`, counted from 1.
  void boxFaces(std::int64_t base) {
    static constexpr int kFaces[6][4] = {{0, 1, 5, 4}, {1, 3, 7, 5}, {4, 5, 7, 6},
                                         {0, 4, 6, 2}, {1, 0, 2, 3}, {3, 2, 6, 7}};
    for (auto const& face : kFaces) {
      m_text += 'f';
      for (int const corner : face) number(base + corner);
      line("");
    }
  }

private:
  static constexpr std::size_t kFlushAt = 1 << 16;

  template <class Number> void number(Number value) {
    char text[64];
    auto const end = std::to_chars(text, text + sizeof text, value).ptr;
    m_text += ' ';
    m_text.append(text, end);
  }
  void flush() {
    m_out.write(m_text.data(), static_cast<std::int64_t>(m_text.size()));
    m_text.clear();
  }

  Stream& m_out;
  std::string m_text;
};

} // namespace VLN::Internal
