#include "Interop/FileError.h"

#include <algorithm>
#include <cstdio>
#include <string_view>

namespace VLN::Interop {

FileError::FileError(std::string file, std::string reason)
    : std::runtime_error(file + ": " + reason)
    , m_file(std::move(file))
    , m_reason(std::move(reason)) {}

FileError::~FileError() = default;

namespace {

// Bytes of the UTF-8 sequence at the begin of `text`; 0 where there is none, or one of a control character.
std::size_t sequenceLength(std::string_view text) {
  auto const byte = [&](std::size_t n) { return static_cast<unsigned char>(text[n]); };
  unsigned const first = byte(0);
  if (first < 0x80) return first < 0x20 || first == 0x7f ? 0 : 1;
  std::size_t const length = first >= 0xf0 ? 4 : first >= 0xe0 ? 3 : 2;
  if (first < 0xc2 || first > 0xf4 || text.size() < length) return 0;
  for (std::size_t n = 1; n < length; ++n)
    if ((byte(n) & 0xc0) != 0x80) return 0;
  unsigned const second = byte(1);
  bool const control = first == 0xc2 && second < 0xa0;
  bool const overlong = (first == 0xe0 && second < 0xa0) || (first == 0xf0 && second < 0x90);
  bool const noCharacter = (first == 0xed && second >= 0xa0) || (first == 0xf4 && second >= 0x90);
  return control || overlong || noCharacter ? 0 : length;
}

} // namespace

std::string oneLine(std::string const& text, std::size_t longest) {
  std::string line;
  std::size_t characters = 0;
  for (std::size_t at = 0; at < text.size(); ++characters) {
    if (characters == longest) {
      line += "...";
      break;
    }
    std::size_t const length = sequenceLength(std::string_view(text).substr(at));
    char const c = text[at];
    if (length > 0) {
      line.append(text, at, length);
    } else if (c == '\n' || c == '\r' || c == '\t') {
      line += ' ';
    } else {
      char escape[8];
      std::snprintf(escape, sizeof escape, "\\x%02x", static_cast<unsigned char>(c));
      line += escape;
    }
    at += std::max<std::size_t>(length, 1);
  }
  while (!line.empty() && line.back() == ' ') line.pop_back();
  return line;
}

} // namespace VLN::Interop
