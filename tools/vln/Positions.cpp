#include "Positions.h"

#include "Interop/FileError.h"

#include <cerrno>
#include <charconv>
#include <cmath>
#include <cstring>

#include <fcntl.h>
#include <fmt/format.h>
#include <sys/stat.h>
#include <unistd.h>

namespace Vln {

namespace {

using VLN::Interop::FileError;

constexpr std::size_t kBlock = 1 << 16;

std::string_view trimmed(std::string_view text) {
  auto const blank = [](char c) { return c == ' ' || c == '\t' || c == '\r'; };
  while (!text.empty() && blank(text.front())) text.remove_prefix(1);
  while (!text.empty() && blank(text.back())) text.remove_suffix(1);
  return text;
}

} // namespace

bool parseNumber(std::string_view text, double& number) {
  text = trimmed(text);
  if (!text.empty() && text.front() == '+') text.remove_prefix(1);
  auto const [end, error] = std::from_chars(text.data(), text.data() + text.size(), number);
  return !text.empty() && error == std::errc() && end == text.data() + text.size() && std::isfinite(number);
}

PositionLines::PositionLines(std::string path)
    : m_name(path == "-" ? "standard input" : std::move(path)) {
  m_fd = m_name == "standard input" ? dup(STDIN_FILENO) : open(m_name.c_str(), O_RDONLY | O_CLOEXEC);
  struct stat info;
  if (m_fd < 0 || fstat(m_fd, &info) != 0) throw FileError(m_name, std::strerror(errno));
  if (S_ISDIR(info.st_mode)) throw FileError(m_name, "is a directory");
  m_streams = !S_ISREG(info.st_mode);
}

PositionLines::~PositionLines() {
  if (m_fd >= 0) close(m_fd);
}

bool PositionLines::next(std::vector<Velorn::Math::double3>& positions) {
  char block[kBlock];
  ssize_t n = 0;
  do { n = read(m_fd, block, sizeof block); } while (n < 0 && errno == EINTR);
  if (n < 0) throw FileError(m_name, std::string("cannot be read: ") + std::strerror(errno));
  if (n == 0) {
    parseLine(m_rest, positions);
    m_rest.clear();
    return false;
  }
  std::string_view text(block, static_cast<std::size_t>(n));
  for (std::size_t end; (end = text.find('\n')) != std::string_view::npos; text.remove_prefix(end + 1)) {
    m_rest += text.substr(0, end);
    parseLine(m_rest, positions);
    m_rest.clear();
  }
  m_rest += text;
  return true;
}

void PositionLines::parseLine(std::string_view line, std::vector<Velorn::Math::double3>& positions) {
  ++m_line;
  if (trimmed(line).empty()) return;
  Velorn::Math::double3 p{};
  bool good = true, anyNumber = false;
  int cells = 0;
  for (bool more = true; more; ++cells) {
    std::size_t const comma = line.find(',');
    more = comma != std::string_view::npos;
    double number = 0;
    bool const parsed = parseNumber(line.substr(0, comma), number);
    anyNumber = anyNumber || parsed;
    good = good && parsed;
    if (cells < 3) p[cells] = number;
    line.remove_prefix(more ? comma + 1 : line.size());
  }
  if (good && cells == 3)
    positions.push_back(p);
  else if (anyNumber || m_line > 1) // else it is a header
    throw FileError(m_name, fmt::format("line {} is not of the form x,y,z", m_line));
}

} // namespace Vln
