#include "Interop/FileError.h"

namespace VLN::Interop {

FileError::FileError(std::string file, std::string reason)
    : std::runtime_error(file + ": " + reason)
    , m_file(std::move(file))
    , m_reason(std::move(reason)) {}

FileError::~FileError() = default;

std::string oneLine(std::string const& text, std::size_t longest) {
  std::string line;
  for (char c : text) {
    if (line.size() == longest) {
      line += "...";
      break;
    }
    if (c == '\n' || c == '\r' || c == '\t')
      line += ' ';
    else
      line += c >= ' ' && c <= '~' ? c : '?';
  }
  while (!line.empty() && line.back() == ' ') line.pop_back();
  return line;
}

} // namespace VLN::Interop
