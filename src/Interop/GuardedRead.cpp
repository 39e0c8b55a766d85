#include "Interop/GuardedReadImpl.h"

#include "Interop/FileError.h"
#include "Interop/SupervisorImpl.h"

#include <tbb/global_control.h>

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <cstring>
#include <fstream>
#include <iostream>
#include <iterator>
#include <new>
#include <optional>
#include <sstream>
#include <utility>

#include <fcntl.h>
#include <poll.h>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

namespace VLN::Interop {

namespace {

constexpr std::uint64_t kMB = 1000000;
constexpr std::uint64_t kStackRoom = 32 * kMB;
constexpr char kOk[] = "ok";

std::string memoryReason(std::uint64_t bytes) {
  return "is damaged, or needs more than " + std::to_string(bytes / kMB) + " MB of memory";
}

// Why a reading failed, from inside a catch block.
std::string readFailure(std::uint64_t memoryBytes) {
  try {
    throw;
  } catch (FileError const& error) { return error.reason(); } catch (std::bad_alloc const&) {
    return memoryReason(memoryBytes);
  } catch (std::length_error const&) {
    return "is damaged: it claims a size that cannot be";
  } catch (std::ios::failure const&) {
    return "is truncated or damaged: data that it announces is missing";
  } catch (std::exception const& error) { return "cannot be read: " + oneLine(error.what()); } catch (...) {
    return "cannot be read";
  }
}

std::uint64_t availableMemory() {
  std::ifstream in("/proc/meminfo");
  std::string name, unit;
  std::uint64_t kB = 0;
  while (in >> name >> kB) {
    if (name == "MemAvailable:") return kB * 1024;
    std::getline(in, unit);
  }
  return static_cast<std::uint64_t>(sysconf(_SC_PHYS_PAGES)) *
         static_cast<std::uint64_t>(sysconf(_SC_PAGESIZE));
}

// Of /proc/<process>/statm, in bytes: the address space, and the resident memory that is no file's. A child
// begins with all of its parent's memory but not with its pages of files: with those counted, a child of a
// large program could grow by as much unseen.
struct Memory {
  std::uint64_t space = 0, own = 0;
};
Memory memoryOf(char const* process) {
  std::ifstream in(std::string("/proc/") + process + "/statm");
  std::uint64_t space = 0, resident = 0, ofFiles = 0;
  in >> space >> resident >> ofFiles;
  auto const page = static_cast<std::uint64_t>(sysconf(_SC_PAGESIZE));
  return {space * page, (resident - std::min(resident, ofFiles)) * page};
}

// What a process is doing, and its processor time so far in clock ticks.
struct Activity {
  char state = '?';
  std::uint64_t ticks = 0;
  bool operator==(Activity const&) const = default;
};
Activity activityOf(std::string const& process) {
  std::ifstream in("/proc/" + process + "/stat");
  std::string const text((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
  // The name, in brackets, may hold anything.
  std::size_t const name = text.rfind(')');
  if (name == std::string::npos) return {};
  std::istringstream fields(text.substr(name + 1));
  Activity activity;
  fields >> activity.state;
  std::string other;
  for (int n = 0; n < 10; ++n) fields >> other;
  std::uint64_t user = 0, system = 0;
  fields >> user >> system;
  activity.ticks = user + system;
  return activity;
}

double seconds() {
  timespec now;
  clock_gettime(CLOCK_MONOTONIC, &now);
  return double(now.tv_sec) + 1e-9 * double(now.tv_nsec);
}

// A lower limit for what is left of its life.
class ScopedLimit {
public:
  ScopedLimit(decltype(RLIMIT_AS) resource, std::uint64_t most)
      : m_resource(resource) {
    if (getrlimit(resource, &m_before) != 0) return;
    rlimit limit = m_before;
    limit.rlim_cur = std::min<rlim_t>(most, m_before.rlim_cur);
    m_isSet = setrlimit(resource, &limit) == 0;
  }
  ScopedLimit(ScopedLimit const&) = delete;
  ScopedLimit& operator=(ScopedLimit const&) = delete;
  ~ScopedLimit() {
    if (m_isSet) setrlimit(m_resource, &m_before);
  }

private:
  decltype(RLIMIT_AS) m_resource;
  rlimit m_before = {};
  bool m_isSet = false;
};

void writeAll(int fd, std::string const& text) {
  char const* next = text.data();
  std::size_t left = text.size();
  while (left > 0) {
    ssize_t const n = ::write(fd, next, left);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return;
    next += n, left -= static_cast<std::size_t>(n);
  }
}

// Out of memory in the child: an exception would need memory on its way, so the verdict is given at once.
int verdictEnd = -1;
std::string const* memoryVerdict = nullptr;
void onNoMemory() {
  writeAll(verdictEnd, *memoryVerdict);
  _exit(0);
}

// Crashes end the child, whatever the program does with them.
class PlainCrashes {
public:
  PlainCrashes() {
    for (std::size_t n = 0; n < std::size(kSignals); ++n) {
      struct sigaction plain = {};
      plain.sa_handler = SIG_DFL;
      sigaction(kSignals[n], &plain, &m_before[n]);
    }
  }
  PlainCrashes(PlainCrashes const&) = delete;
  PlainCrashes& operator=(PlainCrashes const&) = delete;
  ~PlainCrashes() {
    for (std::size_t n = 0; n < std::size(kSignals); ++n) sigaction(kSignals[n], &m_before[n], nullptr);
  }

private:
  static constexpr int kSignals[] = {SIGSEGV, SIGBUS, SIGFPE, SIGILL, SIGABRT, SIGXCPU};
  struct sigaction m_before[std::size(kSignals)];
};

// Keeps what libraries print: it is for users once the file is known to be sound.
class HeldOutput {
public:
  HeldOutput() {
    for (std::size_t n = 0; n < 3; ++n) m_buffers[n] = stream(n).rdbuf(m_text.rdbuf());
    int const null = open("/dev/null", O_RDWR | O_CLOEXEC);
    for (int n = 0; n < 3; ++n) {
      m_files[n] = fcntl(n, F_DUPFD_CLOEXEC, 3);
      if (null >= 0) dup2(null, n);
    }
    if (null >= 0) close(null);
  }
  HeldOutput(HeldOutput const&) = delete;
  HeldOutput& operator=(HeldOutput const&) = delete;
  ~HeldOutput() {
    for (int n = 0; n < 3; ++n) {
      // What was closed before is closed again.
      if (m_files[n] < 0) {
        close(n);
        continue;
      }
      dup2(m_files[n], n);
      close(m_files[n]);
    }
    for (std::size_t n = 0; n < 3; ++n) stream(n).rdbuf(m_buffers[n]);
    try {
      std::cout << m_text.str() << std::flush;
    } catch (...) {} // words that there is no memory for
  }

private:
  static std::ostream& stream(std::size_t n) { return n == 0 ? std::cout : n == 1 ? std::cerr : std::clog; }

  std::ostringstream m_text;
  std::streambuf* m_buffers[3];
  int m_files[3];
};

// Reads within the limits and writes "ok", or the reason why not. Where the child shall go on as the program,
// it returns what it read when the parent says so; else it ends here.
VdbFile readInChild(ReadGrids const& read, VdbReadLimits const& limits, Memory const& start, int fd,
                    std::string const& noMemory, bool goesOn) {
  // The parent's worker threads do not exist here: loops that OpenVDB runs while it reads or gives up must
  // not wait for them.
  tbb::global_control const alone(tbb::global_control::max_allowed_parallelism, 1);
  verdictEnd = fd, memoryVerdict = &noMemory;
  auto const handler = std::set_new_handler(onNoMemory);
  prctl(PR_SET_PDEATHSIG, SIGKILL); // nobody waits for the verdict of an orphan
  // A sanitizer reserves address space by the terabyte; there the parent's watch over its memory is the
  // only bound.
  std::optional<ScopedLimit> space;
  // Without room for a stack even the verdict that there is no memory would fail.
  if (start.space < (std::uint64_t(1) << 40))
    space.emplace(RLIMIT_AS, start.space + std::max(limits.memoryBytes, kStackRoom));
  ScopedLimit const time(RLIMIT_CPU, limits.seconds), core(RLIMIT_CORE, 0);
  PlainCrashes const crashes;
  if (!goesOn)
    for (int n : {SIGTERM, SIGINT}) signal(n, SIG_DFL);
  HeldOutput const output;
  try {
    VdbFile file = read();
    // The parent may not have looked since: a child can be quicker than the watch.
    bool const fits = memoryOf("self").own <= start.own + limits.memoryBytes;
    writeAll(fd, fits ? kOk : noMemory);
    char go = 0;
    if (!fits || !goesOn || ::read(fd, &go, 1) != 1) _exit(0);
    std::set_new_handler(handler);
    return file;
  } catch (...) { writeAll(fd, readFailure(limits.memoryBytes)); }
  _exit(0);
}

// The child's whole life, but where it goes on as the program. It does not return else, whatever is thrown:
// what left this function would go on as a second copy of the parent.
// @param noMemory Made before the fork: the child may have no memory for it.
VdbFile runChild(ReadGrids const& read, VdbReadLimits const& limits, Memory const& start, int fd,
                 std::string const& noMemory, bool goesOn) noexcept {
  try {
    return readInChild(read, limits, start, fd, noMemory, goesOn);
  } catch (...) { writeAll(fd, noMemory); }
  _exit(0);
}

// The parent's side. Where watching ends early, by what is thrown, the child ends too.
struct Child {
  int end = -1;
  pid_t process = -1;

  /// Lets go of the end.
  int release() {
    process = -1;
    return std::exchange(end, -1);
  }
  int wait() {
    int status = 0;
    while (waitpid(process, &status, 0) < 0 && errno == EINTR) {}
    process = -1;
    return status;
  }
  ~Child() {
    if (end >= 0) close(end);
    if (process < 0) return;
    kill(process, SIGKILL);
    wait();
  }
};

// What came of a child.
struct Verdict {
  std::string text;                  ///< what it wrote
  std::optional<std::string> reason; ///< why it was stopped
  bool stalled = false;              ///< it was stopped because it slept for `stallSeconds` without a break
};

// Collects what the child writes until it ends. Stops it when it takes too much.
Verdict watchChild(int fd, pid_t child, VdbReadLimits const& limits, Memory const& start,
                   double stallSeconds) {
  std::string const process = std::to_string(child);
  // The processor time is bounded by the system; this is for a child that waits for ever.
  double const patience = 60 + 10.0 * limits.seconds, begin = seconds();
  Verdict verdict;
  Activity activity;
  double activeAt = begin;
  for (;;) {
    pollfd wait{fd, POLLIN, 0};
    int const ready = poll(&wait, 1, 20);
    if (ready < 0 && errno != EINTR) return verdict;
    if (ready > 0) {
      char buffer[1024];
      ssize_t const n = read(fd, buffer, sizeof buffer);
      if (n < 0 && errno == EINTR) continue;
      if (n <= 0) return verdict;
      if (verdict.text.size() < 4096) verdict.text.append(buffer, static_cast<std::size_t>(n));
      if (verdict.text == kOk) return verdict; // of one that may wait to go on
      continue;
    }
    double const now = seconds();
    Activity const seen = activityOf(process);
    if (seen.state != 'S' || !(seen == activity)) activity = seen, activeAt = now;
    verdict.stalled = now - activeAt > stallSeconds;
    if (memoryOf(process.c_str()).own > start.own + limits.memoryBytes)
      verdict.reason = memoryReason(limits.memoryBytes);
    else if (now - begin > patience)
      verdict.reason = "cannot be read in " + std::to_string(static_cast<long>(patience)) + " s";
    if (verdict.reason || verdict.stalled) {
      kill(child, SIGKILL);
      return verdict;
    }
  }
}

enum class Outcome { kSound, kStalled, kGoesOn };

// Reads the file in one child.
// @return kStalled where nothing is known of the file; kGoesOn in the child, with what it read.
Outcome readOnce(std::string const& path, ReadGrids const& read, VdbReadLimits const& limits,
                 double stallSeconds, VdbFile* file) {
  Memory const start = memoryOf("self");
  std::string const noMemory = memoryReason(limits.memoryBytes);
  int ends[2];
  if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends) != 0)
    throw FileError(path, std::string("no pipe: ") + std::strerror(errno));
  Child child{ends[0], fork()};
  int const error = errno;
  if (child.process == 0) {
    close(child.release());
    VdbFile content = runChild(read, limits, start, ends[1], noMemory, file != nullptr);
    close(ends[1]);
    *file = std::move(content);
    goneOn();
    return Outcome::kGoesOn;
  }
  close(ends[1]);
  if (child.process < 0)
    throw FileError(path, std::string("no process to read it in: ") + std::strerror(error));
  Verdict verdict = watchChild(child.end, child.process, limits, start, stallSeconds);
  if (verdict.text == kOk && !verdict.reason && !verdict.stalled) {
    if (file) endAs(child.process, child.end);
    return Outcome::kSound;
  }
  int const status = child.wait();
  if (verdict.stalled && !verdict.reason) return Outcome::kStalled;
  if (verdict.reason) throw FileError(path, *verdict.reason);
  if (WIFSIGNALED(status)) {
    int const number = WTERMSIG(status);
    if (number == SIGXCPU || number == SIGKILL)
      throw FileError(path, "is damaged, or takes more than " + std::to_string(limits.seconds) +
                                " s of processor time");
    throw FileError(path, std::string("is damaged: reading it ends in \"") + strsignal(number) + "\"");
  }
  if (verdict.text.empty()) throw FileError(path, "is damaged: reading it ends without a word");
  throw FileError(path, verdict.text);
}

// @return Whether this is the child, which has read the file.
bool readInSomeChild(std::string const& path, ReadGrids const& read, VdbReadLimits const& limits,
                     VdbFile* file) {
  // A worker thread that happened to hold one of the scheduler's locks while the child was made does not
  // exist in the child, which then waits for ever. Another child will not have that bad luck. One that waits
  // for a slow disk looks the same, so that each has more time than the one before.
  for (double stallSeconds = 0.25;; stallSeconds *= 2) {
    Outcome const outcome = readOnce(path, read, limits, stallSeconds, file);
    if (outcome != Outcome::kStalled) return outcome == Outcome::kGoesOn;
  }
}

} // namespace

VdbReadLimits effectiveLimits(VdbReadLimits limits, std::uint64_t fileSize) {
  if (limits.memoryBytes == 0) limits.memoryBytes = availableMemory() / 4 * 3;
  if (limits.seconds == 0)
    limits.seconds = static_cast<unsigned>(10 + std::min<std::uint64_t>(fileSize / kMB, 100000));
  return limits;
}

VdbReadLimits probeInChild(std::string const& path, VdbReadLimits const& asked, std::uint64_t fileSize,
                           ReadGrids const& read) {
  VdbReadLimits limits = effectiveLimits(asked, fileSize);
  readInSomeChild(path, read, limits, nullptr);
  return limits;
}

VdbFile readGuarded(std::string const& path, VdbReadLimits const& asked, std::uint64_t fileSize,
                    ReadGrids const& read) {
  VdbReadLimits const limits = effectiveLimits(asked, fileSize);
  VdbFile file;
  if (!readInSomeChild(path, read, limits, mayGoOn() ? &file : nullptr)) {
    try {
      file = read();
    } catch (...) { throw FileError(path, readFailure(limits.memoryBytes)); }
  }
  file.memoryBytes = limits.memoryBytes;
  return file;
}

} // namespace VLN::Interop
