#include "Interop/OutputFolder.h"

#include "Interop/FileError.h"
#include "Interop/OutputTargetImpl.h"
#include "Interop/UnfinishedImpl.h"

#include <cerrno>
#include <climits>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

namespace VLN::Interop {

namespace {

Unfinished<4> unfinished;

/// Removes a folder with all in it, by system calls alone: signal handlers may do so. Links are not followed.
void removeTree(int parent, char const* name, int levels) noexcept {
  if (levels == 0) return;
  int const folder = openat(parent, name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
  if (folder < 0) return;
  struct Entry { // as the system writes it
    std::uint64_t inode;
    std::int64_t next;
    unsigned short length;
    unsigned char type;
    char name[1];
  };
  alignas(Entry) char block[4096];
  // Removing while reading may hide entries: again from the start until nothing goes any more.
  for (bool removed = true; removed;) {
    removed = false;
    lseek(folder, 0, SEEK_SET);
    for (long got; (got = syscall(SYS_getdents64, folder, block, sizeof block)) > 0;)
      for (long at = 0; at < got;) {
        auto const* const entry = reinterpret_cast<Entry const*>(block + at);
        at += entry->length;
        char const* const n = entry->name;
        if (n[0] == '.' && (n[1] == '\0' || (n[1] == '.' && n[2] == '\0'))) continue;
        if (unlinkat(folder, n, 0) == 0) {
          removed = true;
          continue;
        }
        removeTree(folder, n, levels - 1);
        removed = unlinkat(folder, n, AT_REMOVEDIR) == 0 || removed;
      }
  }
  close(folder);
  unlinkat(parent, name, AT_REMOVEDIR);
}

constexpr int kLevels = 64; ///< of folders, more than any of ours has

[[noreturn]] void fail(std::string const& path, int error) {
  throw FileError(path, std::string("cannot be written: ") + std::strerror(error));
}

/// Where a folder of that name goes: behind links, without slashes at the end.
std::string targetOf(std::string const& path, std::string const& mark) {
  if (path.empty() || path.find('\0') != std::string::npos) throw FileError("''", "is no name for a file");
  std::string target = path;
  while (target.size() > 1 && target.back() == '/') target.pop_back();
  struct stat info;
  if (lstat(target.c_str(), &info) != 0) {
    if (errno != ENOENT) fail(path, errno);
    return target;
  }
  char resolved[PATH_MAX];
  if (!realpath(target.c_str(), resolved)) fail(path, errno);
  target = resolved;
  if (stat(target.c_str(), &info) != 0) fail(path, errno);
  if (!S_ISDIR(info.st_mode)) throw FileError(path, "is a file, and a folder would be written");
  std::error_code error;
  bool const ours = access((target + "/" + mark).c_str(), F_OK) == 0;
  if (!ours && !std::filesystem::is_empty(target, error))
    throw FileError(path, "is a folder that holds something else");
  if (error) fail(path, error.value());
  if (access(target.c_str(), W_OK) != 0) fail(path, errno);
  return target;
}

std::string makeBeside(std::string const& path, std::string const& target) {
  auto const slash = target.rfind('/');
  std::string folder = (slash == std::string::npos ? "" : target.substr(0, slash + 1)) + ".vln-XXXXXX";
  if (!mkdtemp(folder.data())) fail(path, errno);
  return folder;
}

} // namespace

OutputFolder::OutputFolder(std::string path, std::string const& mark)
    : m_path(std::move(path))
    , m_target(targetOf(m_path, mark))
    , m_temporary(makeBeside(m_path, m_target)) {
  unfinished.add(m_temporary);
}

OutputFolder::~OutputFolder() {
  if (m_temporary.empty()) return;
  removeTree(AT_FDCWD, m_temporary.c_str(), kLevels);
  unfinished.remove(m_temporary);
}

void OutputFolder::write(std::string const& name, void const* bytes, std::size_t count) const {
  std::string const path = m_temporary + "/" + name;
  int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0666);
  if (fd < 0 && errno == ENOENT) {
    for (auto at = m_temporary.size() + 1; (at = path.find('/', at)) != std::string::npos; ++at)
      if (mkdir(path.substr(0, at).c_str(), 0777) != 0 && errno != EEXIST) fail(m_path, errno);
    fd = open(path.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0666);
  }
  if (fd < 0) fail(m_path, errno);
  int error = writeAll(fd, bytes, count);
  if (close(fd) != 0 && !error) error = errno;
  if (error) fail(m_path, error);
}

void OutputFolder::commit() {
  int const folder = open(m_temporary.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  if (folder < 0) fail(m_path, errno);
  // One call for all files: one for each would take longer than writing them.
  int const error = syncfs(folder) == 0 ? 0 : errno;
  // mkdtemp() makes a folder for its owner alone; a new one gets what a file of ours gave away with 0777.
  struct stat old;
  mode_t mode = 0;
  bool const exists = stat(m_target.c_str(), &old) == 0;
  if (exists)
    mode = old.st_mode & 07777;
  else if (std::string const probe = m_temporary + "/.mode"; mkdir(probe.c_str(), 0777) == 0) {
    struct stat made;
    mode = stat(probe.c_str(), &made) == 0 ? made.st_mode & 0777 : 0755;
    rmdir(probe.c_str());
  }
  int const changed = fchmod(folder, mode ? mode : 0755) == 0 ? 0 : errno;
  close(folder);
  if (error) fail(m_path, error);
  if (changed) fail(m_path, changed);
  if (!exists) {
    if (rename(m_temporary.c_str(), m_target.c_str()) != 0) fail(m_path, errno);
    unfinished.remove(m_temporary);
    m_temporary.clear();
    return;
  }
  // In one step, so that there is a whole folder at every moment. Afterwards the old one is removed.
  if (renameat2(AT_FDCWD, m_temporary.c_str(), AT_FDCWD, m_target.c_str(), RENAME_EXCHANGE) == 0) return;
  if (errno != EINVAL && errno != ENOSYS) fail(m_path, errno);
  // A file system that cannot: the old folder is laid aside, and put back if the new one does not go there.
  std::string const aside = makeBeside(m_path, m_target);
  if (rename(m_target.c_str(), aside.c_str()) != 0) {
    int const why = errno;
    rmdir(aside.c_str());
    fail(m_path, why);
  }
  if (rename(m_temporary.c_str(), m_target.c_str()) != 0) {
    int const why = errno;
    rename(aside.c_str(), m_target.c_str());
    fail(m_path, why);
  }
  unfinished.remove(m_temporary);
  m_temporary.clear();
  removeTree(AT_FDCWD, aside.c_str(), kLevels);
}

void checkOutputFolder(std::string const& path, std::string const& mark) {
  OutputFolder const probe(path, mark);
}

void removeUnfinishedFolders() noexcept {
  unfinished.forEach([](char const* path) { removeTree(AT_FDCWD, path, kLevels); });
}

} // namespace VLN::Interop
