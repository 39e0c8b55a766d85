#include "Interop/FileError.h"
#include "Interop/OutputTargetImpl.h"

#include <cerrno>
#include <climits>
#include <cstdlib>
#include <cstring>

#include <sys/stat.h>
#include <sys/vfs.h>
#include <unistd.h>

namespace VLN::Interop {

namespace {

constexpr int kMostLinks = 40; // as many as the system itself follows
constexpr long kProcFileSystem = 0x9fa0;

[[noreturn]] void fail(std::string const& path, int error) {
  throw FileError(path, std::string("cannot be written: ") + std::strerror(error));
}

std::string folderOf(std::string const& path) {
  auto const slash = path.rfind('/');
  return slash == std::string::npos ? "." : slash == 0 ? "/" : path.substr(0, slash);
}

// Links of the process table name open files, which need not have a name of their own.
bool isProcessLink(std::string const& link) {
  struct statfs info;
  return statfs(folderOf(link).c_str(), &info) == 0 && long(info.f_type) == kProcFileSystem;
}

// The number at the end of .../<this process>/fd/<number>, or -1.
int ownDescriptor(std::string const& link) {
  char folder[PATH_MAX];
  if (!realpath(folderOf(link).c_str(), folder)) return -1;
  if (std::string(folder) != "/proc/" + std::to_string(getpid()) + "/fd") return -1;
  return std::atoi(link.c_str() + link.rfind('/') + 1);
}

} // namespace

OutputTarget findOutputTarget(std::string const& path) {
  if (path.empty() || path.find('\0') != std::string::npos) throw FileError("''", "is no name for a file");
  OutputTarget target{path};
  struct stat info;
  for (int links = 0; lstat(target.path.c_str(), &info) == 0 && S_ISLNK(info.st_mode); ++links) {
    if (links == kMostLinks) fail(path, ELOOP);
    if (isProcessLink(target.path)) {
      target.straight = true;
      target.descriptor = ownDescriptor(target.path);
      return target;
    }
    char to[PATH_MAX];
    ssize_t const length = readlink(target.path.c_str(), to, sizeof to);
    if (length < 0) fail(path, errno);
    std::string next(to, static_cast<std::size_t>(length));
    if (next.empty() || next.front() != '/') next = target.path.substr(0, target.path.rfind('/') + 1) + next;
    target.path = std::move(next);
  }
  if (stat(target.path.c_str(), &info) != 0) {
    if (errno != ENOENT) fail(path, errno);
    if (target.path.back() == '/') throw FileError(path, "is no name for a file");
    return target;
  }
  if (S_ISDIR(info.st_mode)) throw FileError(path, "is a directory");
  if (access(target.path.c_str(), W_OK) != 0) fail(path, errno);
  target.straight = !S_ISREG(info.st_mode);
  return target;
}

int writeAll(int descriptor, void const* bytes, std::size_t count) {
  auto const* from = static_cast<char const*>(bytes);
  while (count > 0) {
    ssize_t const n = ::write(descriptor, from, count);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return n < 0 ? errno : EIO;
    from += n, count -= static_cast<std::size_t>(n);
  }
  return 0;
}

} // namespace VLN::Interop
