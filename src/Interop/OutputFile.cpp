#include "Interop/OutputFile.h"

#include "Interop/FileError.h"

#include <atomic>
#include <cerrno>
#include <cstring>

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

namespace VLN::Interop {

namespace {

// The name for the signal handler. One output at a time is enough: a second one is merely not removed when
// the program is interrupted.
constexpr std::size_t kLongest = 4096;
char unfinished[kLongest];
std::atomic<bool> hasUnfinished{false};

void remember(std::string const& path) {
  if (path.size() >= kLongest || hasUnfinished.load()) return;
  std::memcpy(unfinished, path.c_str(), path.size() + 1);
  hasUnfinished.store(true);
}
void forget(std::string const& path) {
  if (hasUnfinished.load() && path == unfinished) hasUnfinished.store(false);
}

[[noreturn]] void fail(std::string const& path, char const* what) {
  throw FileError(path, std::string(what) + ": " + std::strerror(errno));
}

} // namespace

OutputFile::OutputFile(std::string path)
    : m_path(std::move(path)) {
  if (m_path.empty()) throw FileError("''", "is no name for a file");
  struct stat info;
  if (stat(m_path.c_str(), &info) == 0 && !S_ISREG(info.st_mode))
    throw FileError(m_path, S_ISDIR(info.st_mode) ? "is a directory" : "is not a regular file");

  // The process number keeps two programs that write the same file apart, the counter two writers here.
  static std::atomic<unsigned> counter{0};
  auto const slash = m_path.rfind('/');
  std::size_t const begin = slash == std::string::npos ? 0 : slash + 1;
  m_temporaryPath = m_path.substr(0, begin) + "." + m_path.substr(begin) + "." + std::to_string(getpid()) +
                    "-" + std::to_string(counter++) + ".tmp";
  int const fd = open(m_temporaryPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0666);
  if (fd < 0) fail(m_path, "cannot be written");
  close(fd);
  remember(m_temporaryPath);
}

OutputFile::~OutputFile() {
  forget(m_temporaryPath);
  if (!m_committed) unlink(m_temporaryPath.c_str());
}

void OutputFile::write(void const* bytes, std::size_t count) {
  int const fd = open(m_temporaryPath.c_str(), O_WRONLY | O_TRUNC | O_CLOEXEC);
  if (fd < 0) fail(m_path, "cannot be written");
  auto const* next = static_cast<char const*>(bytes);
  while (count > 0) {
    ssize_t const n = ::write(fd, next, count);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) {
      int const error = errno;
      close(fd);
      errno = error;
      fail(m_path, "cannot be written");
    }
    next += n, count -= static_cast<std::size_t>(n);
  }
  if (close(fd) != 0) fail(m_path, "cannot be written");
}

void OutputFile::commit() {
  int const fd = open(m_temporaryPath.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) fail(m_path, "cannot be written");
  // Without this a crash of the machine could leave the new name on an empty file.
  int const synced = fsync(fd);
  int const error = errno;
  close(fd);
  if (synced != 0 && error != EINVAL) {
    errno = error;
    fail(m_path, "cannot be written");
  }
  if (rename(m_temporaryPath.c_str(), m_path.c_str()) != 0) fail(m_path, "cannot be written");
  m_committed = true;
}

void checkOutput(std::string const& path) { OutputFile const probe(path); }

void removeUnfinishedOutput() noexcept {
  if (hasUnfinished.load()) unlink(unfinished);
}

} // namespace VLN::Interop
