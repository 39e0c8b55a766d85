// A library to be loaded before others (LD_PRELOAD) that lets calls of the system fail on purpose.
//
//   VLN_FAULT=call:n:error[:once]   the n-th call, and all later ones unless "once", fails with the error
//   VLN_FAULT=short:n:0             reads from the n-th on give at most seven bytes
//
// Calls are write, fsync, close, rename, mkostemp, fchmod, ftruncate and read. Counted are those on regular
// files: for read any but the system's own, for the others what is open for writing.
#ifndef _GNU_SOURCE
#define _GNU_SOURCE
#endif

#include <atomic>
#include <cerrno>
#include <cstddef>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include <dlfcn.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/vfs.h>
#include <unistd.h>

namespace {

struct Fault {
  char call[32] = "";
  long from = 0;
  int error = 0;
  bool once = false;

  Fault() {
    char mode[8] = "";
    char const* const text = std::getenv("VLN_FAULT");
    if (text) std::sscanf(text, "%31[a-z]:%ld:%d:%7[a-z]", call, &from, &error, mode);
    once = mode[0] != 0;
  }
};

Fault const& fault() {
  static Fault const theFault;
  return theFault;
}

bool isDue(char const* call) {
  static std::atomic<long> count{0};
  Fault const& f = fault();
  if (std::strcmp(f.call, call) != 0) return false;
  long const n = ++count;
  return f.once ? n == f.from : n >= f.from;
}

bool isRegular(int fd) {
  struct stat info;
  struct statfs system;
  constexpr long kProc = 0x9fa0, kSys = 0x62656572;
  return fstat(fd, &info) == 0 && S_ISREG(info.st_mode) && fstatfs(fd, &system) == 0 &&
         long(system.f_type) != kProc && long(system.f_type) != kSys;
}
bool isOutput(int fd) {
  int const flags = fcntl(fd, F_GETFL);
  return fd > 2 && flags >= 0 && (flags & O_ACCMODE) != O_RDONLY && isRegular(fd);
}

template <class F> F next(char const* name) { return reinterpret_cast<F>(dlsym(RTLD_NEXT, name)); }

int failed() {
  errno = fault().error;
  return -1;
}

} // namespace

#define VLN_EXPORT extern "C" __attribute__((visibility("default")))

VLN_EXPORT ssize_t write(int fd, void const* bytes, size_t count) {
  static auto const real = next<ssize_t (*)(int, void const*, size_t)>("write");
  return isOutput(fd) && isDue("write") ? failed() : real(fd, bytes, count);
}
VLN_EXPORT ssize_t read(int fd, void* bytes, size_t count) {
  static auto const real = next<ssize_t (*)(int, void*, size_t)>("read");
  if (isRegular(fd)) {
    if (isDue("read")) return failed();
    if (isDue("short") && count > 7) count = 7;
  }
  return real(fd, bytes, count);
}
VLN_EXPORT int fsync(int fd) {
  static auto const real = next<int (*)(int)>("fsync");
  return isOutput(fd) && isDue("fsync") ? failed() : real(fd);
}
VLN_EXPORT int close(int fd) {
  static auto const real = next<int (*)(int)>("close");
  bool const due = isOutput(fd) && isDue("close");
  int const result = real(fd); // which closes in any case
  return due ? failed() : result;
}
VLN_EXPORT int rename(char const* from, char const* to) noexcept {
  static auto const real = next<int (*)(char const*, char const*)>("rename");
  return isDue("rename") ? failed() : real(from, to);
}
VLN_EXPORT int mkostemp(char* name, int flags) {
  static auto const real = next<int (*)(char*, int)>("mkostemp");
  return isDue("mkostemp") ? failed() : real(name, flags);
}
VLN_EXPORT int fchmod(int fd, mode_t mode) noexcept {
  static auto const real = next<int (*)(int, mode_t)>("fchmod");
  return isOutput(fd) && isDue("fchmod") ? failed() : real(fd, mode);
}
VLN_EXPORT int ftruncate(int fd, off_t length) noexcept {
  static auto const real = next<int (*)(int, off_t)>("ftruncate");
  return isOutput(fd) && isDue("ftruncate") ? failed() : real(fd, length);
}
