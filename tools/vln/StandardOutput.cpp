#include "StandardOutput.h"

#include "Interop/FileError.h"

#include <cerrno>
#include <iostream>

#include <sys/stat.h>
#include <unistd.h>

namespace Vln {

namespace {

constexpr std::size_t kCollect = 1 << 16;

class StandardOutput : public std::streambuf {
public:
  int close() {
    sync();
    // A program that was started without one has said nothing that could be lost.
    if (::close(STDOUT_FILENO) != 0 && errno != EBADF && m_error == 0) m_error = errno;
    return m_error;
  }

protected:
  int overflow(int c) override {
    if (m_error == 0 && c != traits_type::eof()) m_collected += static_cast<char>(c);
    if (m_collected.size() >= kCollect) flushCollected();
    return m_error == 0 ? traits_type::not_eof(c) : traits_type::eof();
  }
  std::streamsize xsputn(char const* text, std::streamsize count) override {
    if (m_error == 0) m_collected.append(text, static_cast<std::size_t>(count));
    if (m_collected.size() >= kCollect) flushCollected();
    return m_error == 0 ? count : 0;
  }
  int sync() override {
    flushCollected();
    return m_error == 0 ? 0 : -1;
  }

private:
  void flushCollected() {
    char const* next = m_collected.data();
    std::size_t left = m_collected.size();
    while (left > 0 && m_error == 0) {
      ssize_t const n = ::write(STDOUT_FILENO, next, left);
      if (n < 0 && errno == EINTR) continue;
      if (n > 0)
        next += n, left -= static_cast<std::size_t>(n);
      else
        m_error = n < 0 ? errno : EIO;
    }
    m_collected.clear();
  }

  std::string m_collected;
  int m_error = 0;
};

StandardOutput& buffer() {
  static StandardOutput standardOutput;
  return standardOutput;
}

// Without the escape sequences that colour it.
std::string plain(std::string const& text) {
  std::string result;
  for (std::size_t n = 0; n < text.size(); ++n) {
    if (text[n] == '\033') {
      while (n < text.size() && text[n] != 'm') ++n;
      continue;
    }
    if (text[n] != ' ' || !result.empty()) result += text[n];
  }
  return result;
}

} // namespace

std::ostream& out() {
  static std::ostream stream(&buffer());
  return stream;
}

int closeOutput() { return buffer().close(); }

std::ostream& remarks(std::string const& output) {
  struct stat file, own;
  bool const same = stat(output.c_str(), &file) == 0 && fstat(STDOUT_FILENO, &own) == 0 &&
                    file.st_dev == own.st_dev && file.st_ino == own.st_ino && !S_ISCHR(own.st_mode);
  return same ? std::cerr : out();
}

ForeignLines::ForeignLines()
    : m_old(std::cout.rdbuf(this)) {}

ForeignLines::~ForeignLines() {
  tell();
  std::cout.rdbuf(m_old);
}

int ForeignLines::overflow(int c) {
  if (c == '\n')
    tell();
  else if (c != traits_type::eof())
    m_line += static_cast<char>(c);
  return traits_type::not_eof(c);
}

void ForeignLines::tell() {
  std::string const text = plain(m_line);
  m_line.clear();
  if (!text.empty()) std::cerr << "vln: note: OpenVDB: " << VLN::Interop::oneLine(text) << "\n";
}

OwnLines::OwnLines()
    : m_old(std::cout.rdbuf(&buffer())) {}

OwnLines::~OwnLines() { std::cout.rdbuf(m_old); }

} // namespace Vln
