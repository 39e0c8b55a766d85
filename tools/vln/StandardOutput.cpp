#include "StandardOutput.h"

#include <cerrno>
#include <iostream>

#include <sys/stat.h>
#include <unistd.h>

namespace Vln {

namespace {

constexpr std::size_t kCollect = 1 << 16;

} // namespace

StandardOutput::StandardOutput()
    : m_old(std::cout.rdbuf(this)) {}

StandardOutput::~StandardOutput() { std::cout.rdbuf(m_old); }

int StandardOutput::overflow(int c) {
  if (m_error != 0) return traits_type::eof();
  if (c != traits_type::eof()) m_collected += static_cast<char>(c);
  if (m_collected.size() >= kCollect) flushCollected();
  return m_error == 0 ? traits_type::not_eof(c) : traits_type::eof();
}

int StandardOutput::sync() {
  if (m_error == 0) flushCollected();
  return m_error == 0 ? 0 : -1;
}

void StandardOutput::flushCollected() {
  char const* next = m_collected.data();
  std::size_t left = m_collected.size();
  while (left > 0 && m_error == 0) {
    ssize_t const n = ::write(STDOUT_FILENO, next, left);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0)
      m_error = n < 0 ? errno : EIO;
    else
      next += n, left -= static_cast<std::size_t>(n);
  }
  m_collected.clear();
}

int StandardOutput::close() {
  sync();
  // A program that was started without one has said nothing that could be lost.
  if (::close(STDOUT_FILENO) != 0 && errno != EBADF && m_error == 0) m_error = errno;
  return m_error;
}

std::ostream& remarks(std::string const& output) {
  struct stat file, own;
  bool const same = stat(output.c_str(), &file) == 0 && fstat(STDOUT_FILENO, &own) == 0 &&
                    file.st_dev == own.st_dev && file.st_ino == own.st_ino && !S_ISCHR(own.st_mode);
  return same ? std::cerr : std::cout;
}

} // namespace Vln
