#include "Interop/OutputFile.h"

#include "Interop/FileError.h"
#include "Interop/OutputFolder.h"
#include "Interop/OutputTargetImpl.h"
#include "Interop/UnfinishedImpl.h"

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

namespace VLN::Interop {

namespace {

constexpr std::size_t kCollect = 1 << 18;

Unfinished<8> unfinished;

// What open() would take away from the mode of a new file. Asking by umask() itself would change it for a
// moment, for other threads too.
mode_t creationMask() {
  mode_t mask = 022;
  if (std::FILE* status = std::fopen("/proc/self/status", "re")) {
    char line[256];
    unsigned value = 0;
    while (std::fgets(line, sizeof line, status))
      if (std::sscanf(line, "Umask: %o", &value) == 1) mask = static_cast<mode_t>(value);
    std::fclose(status);
  }
  return mask;
}

// A file of a short name in the folder of `target`; the name is none that could be foreseen.
int openTemporary(std::string const& target, std::string& path) {
  path = target.substr(0, target.rfind('/') + 1) + ".vln-XXXXXX";
  int const fd = mkostemp(path.data(), O_CLOEXEC);
  if (fd < 0) path.clear();
  return fd;
}

int sync(int fd) {
  // Some file systems have no such thing.
  return fsync(fd) == 0 || errno == EINVAL || errno == ENOTSUP ? 0 : errno;
}

int copyInto(int to, int from) {
  char block[1 << 16];
  if (lseek(from, 0, SEEK_SET) != 0 || lseek(to, 0, SEEK_SET) != 0) return errno;
  off_t size = 0;
  for (;;) {
    ssize_t const n = ::read(from, block, sizeof block);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) return errno;
    if (n == 0) break;
    if (int const error = writeAll(to, block, static_cast<std::size_t>(n))) return error;
    size += n;
  }
  return ftruncate(to, size) == 0 ? sync(to) : errno;
}

// Puts the content of `from` into an existing file. Its old content is laid aside first, and put back where
// the new one does not fit in.
int refill(std::string const& target, int from) {
  int const to = open(target.c_str(), O_RDWR | O_CLOEXEC);
  if (to < 0) return errno;
  std::string backup;
  int const old = openTemporary(target, backup);
  int error = old < 0 ? errno : copyInto(old, to);
  bool keep = false;
  if (!error && (error = copyInto(to, from)) != 0) keep = copyInto(to, old) != 0;
  if (close(to) != 0 && !error) error = errno;
  if (old >= 0) close(old);
  if (old >= 0 && !keep) unlink(backup.c_str());
  if (keep)
    throw FileError(target, std::string("cannot be written: ") + std::strerror(error) +
                                "; its old content lies in " + backup);
  return error;
}

} // namespace

OutputFile::OutputFile(std::string path)
    : m_path(std::move(path)) {
  OutputTarget const target = findOutputTarget(m_path);
  m_target = target.path;
  if (target.straight) {
    m_way = Way::kStraight;
    m_fd = target.descriptor >= 0 ? fcntl(target.descriptor, F_DUPFD_CLOEXEC, 0)
                                  : open(m_target.c_str(), O_WRONLY | O_CLOEXEC | O_NOCTTY);
    if (m_fd < 0) fail(errno);
    return;
  }
  m_fd = openTemporary(m_target, m_temporary);
  if (m_fd < 0) fail(errno);
  unfinished.add(m_temporary);
  struct stat old;
  if (stat(m_target.c_str(), &old) != 0) {
    if (fchmod(m_fd, 0666 & ~creationMask()) != 0) fail(errno);
    return;
  }
  struct stat own;
  bool const sameOwner = fstat(m_fd, &own) == 0 && own.st_uid == old.st_uid && own.st_gid == old.st_gid;
  if (old.st_nlink > 1 || (!sameOwner && fchown(m_fd, old.st_uid, old.st_gid) != 0)) m_way = Way::kRefill;
  if (m_way == Way::kReplace && fchmod(m_fd, old.st_mode & 07777) != 0) fail(errno);
}

OutputFile::~OutputFile() {
  if (m_fd >= 0) close(m_fd);
  if (m_temporary.empty()) return;
  unlink(m_temporary.c_str());
  unfinished.remove(m_temporary);
}

void OutputFile::fail(int error) {
  m_failed = true;
  // A constructor that throws gets no destructor.
  if (m_fd >= 0) close(m_fd), m_fd = -1;
  if (!m_temporary.empty()) unlink(m_temporary.c_str()), unfinished.remove(m_temporary), m_temporary.clear();
  throw FileError(m_path, std::string("cannot be written: ") + std::strerror(error));
}

void OutputFile::put(char const* bytes, std::size_t count) {
  if (int const error = writeAll(m_fd, bytes, count)) fail(error);
}

void OutputFile::write(void const* bytes, std::size_t count) {
  if (m_failed || m_fd < 0) fail(EBADF);
  auto const* from = static_cast<char const*>(bytes);
  if (m_collected.size() + count < kCollect) {
    m_collected.append(from, count);
    return;
  }
  put(m_collected.data(), m_collected.size());
  m_collected.clear();
  if (count < kCollect)
    m_collected.append(from, count);
  else
    put(from, count);
}

void OutputFile::finish() {
  if (m_failed) fail(EBADF);
  if (m_fd < 0) return;
  put(m_collected.data(), m_collected.size());
  m_collected.clear();
  // Without this a crash of the machine could leave the new name on an empty file.
  if (m_way != Way::kStraight)
    if (int const error = sync(m_fd)) fail(error);
  if (m_way == Way::kRefill) return; // it is read again
  int const fd = m_fd;
  m_fd = -1;
  // What a disk in the net could not take is told here at the latest.
  if (close(fd) != 0) fail(errno);
}

void OutputFile::commit() {
  finish();
  if (m_way == Way::kRefill)
    if (int const error = refill(m_target, m_fd)) fail(error);
  if (m_way != Way::kReplace) return;
  if (rename(m_temporary.c_str(), m_target.c_str()) != 0) fail(errno);
  unfinished.remove(m_temporary);
  m_temporary.clear();
}

void checkOutput(std::string const& path) {
  OutputTarget const target = findOutputTarget(path);
  // A pipe that is opened and closed would end for its reader.
  if (!target.straight) OutputFile const probe(path);
}

void removeUnfinishedOutput() noexcept {
  unfinished.forEach([](char const* path) { unlink(path); });
  removeUnfinishedFolders();
}

} // namespace VLN::Interop
