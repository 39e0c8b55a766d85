#include "Interop/VdbFile.h"

#include "Interop/ChildProbeImpl.h"
#include "Interop/FileError.h"
#include "Interop/VdbFileImpl.h"

#include <openvdb/io/Archive.h>
#include <openvdb/io/GridDescriptor.h>
#include <openvdb/io/io.h>
#include <tbb/global_control.h>

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <cstring>
#include <fstream>
#include <iterator>
#include <new>
#include <optional>
#include <sstream>

#include <fcntl.h>
#include <poll.h>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

namespace VLN::Interop {

namespace {

constexpr std::uint64_t kMB = 1000000;
constexpr std::uint64_t kStackRoom = 32 * kMB;

// Regular file that starts as a .vdb file does. Returns its size.
std::uint64_t checkHeader(std::string const& path) {
  std::uint64_t const size = regularFileSize(path);
  std::ifstream in(path, std::ios::binary);
  unsigned char head[8] = {};
  in.read(reinterpret_cast<char*>(head), sizeof head);
  static constexpr unsigned char kMagic[8] = {0x20, 0x42, 0x44, 0x56, 0, 0, 0, 0};
  auto const got = static_cast<std::size_t>(in.gcount());
  if (std::memcmp(head, kMagic, std::min(got, sizeof head)) != 0)
    throw FileError(path, "is not an OpenVDB file");
  if (got < sizeof head) throw FileError(path, "is truncated");
  return size;
}

// OpenVDB's own readers give a file up at the first grid of a type that is not registered. This one goes on
// behind it.
class WholeReader : public openvdb::io::Archive {
public:
  void read(std::istream& in, VdbFile& file) {
    readHeader(in);
    auto streamMetadata = std::make_shared<openvdb::io::StreamMetadata>();
    openvdb::io::setStreamMetadataPtr(in, streamMetadata, /*transfer=*/false);
    openvdb::io::setVersion(in, libraryVersion(), fileVersion());
    setDataCompression(in);
    file.metadata = std::make_shared<openvdb::MetaMap>();
    file.metadata->readMeta(in);
    std::int32_t const count = readGridCount(in);
    std::vector<openvdb::io::GridDescriptor> descriptors;
    NamedGridMap byName;
    for (std::int32_t n = 0; n < count; ++n) {
      openvdb::io::GridDescriptor descriptor;
      auto const grid = create(in, descriptor);
      if (!grid) {
        skip(in, descriptor, file);
        continue;
      }
      readGrid(grid, descriptor, in);
      descriptors.push_back(descriptor);
      file.grids.push_back(grid);
      byName[descriptor.uniqueName()] = grid;
    }
    for (auto const& descriptor : descriptors) connectInstance(descriptor, byName);
  }

private:
  // Null for an unknown type: the offsets come next then.
  static openvdb::GridBase::Ptr create(std::istream& in, openvdb::io::GridDescriptor& descriptor) {
    try {
      return descriptor.read(in);
    } catch (openvdb::LookupError const&) { return nullptr; }
  }

  void skip(std::istream& in, openvdb::io::GridDescriptor const& descriptor, VdbFile& file) {
    std::int64_t offsets[3] = {}; // of the grid, of its blocks, of its end
    in.read(reinterpret_cast<char*>(offsets), sizeof offsets);
    if (!inputHasGridOffsets() || offsets[2] < in.tellg())
      throw std::runtime_error("grids of type " + oneLine(descriptor.gridType(), 60) + " are not read");
    in.seekg(offsets[2]);
    file.skipped.push_back({openvdb::io::GridDescriptor::nameAsString(descriptor.uniqueName()),
                            "grids of type " + oneLine(descriptor.gridType()) + " are not read"});
  }
};

// Reads from a stream that throws at the first byte that is missing: OpenVDB itself does not ask whether its
// reads succeed, and would go on with whatever its buffers hold.
VdbFile readWhole(std::string const& path) {
  openvdb::initialize();
  VdbFile file;
  file.path = path;
  std::ifstream in(path, std::ios::binary);
  if (!in) throw FileError(path, std::string("cannot be opened: ") + std::strerror(errno));
  in.exceptions(std::ios::failbit | std::ios::badbit | std::ios::eofbit);
  WholeReader().read(in, file);
  return file;
}

std::string memoryReason(std::uint64_t bytes) {
  return "is damaged, or needs more than " + std::to_string(bytes / kMB) + " MB of memory";
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

void setLimit(decltype(RLIMIT_AS) resource, std::uint64_t soft, std::uint64_t hard) {
  rlimit limit;
  if (getrlimit(resource, &limit) != 0) return;
  limit.rlim_cur = std::min<rlim_t>(soft, limit.rlim_max);
  limit.rlim_max = std::min<rlim_t>(hard, limit.rlim_max);
  setrlimit(resource, &limit);
}

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

// Writes "ok", or the reason why not.
void readInChild(ReadInChild const& read, VdbReadLimits const& limits, Memory const& start, int fd,
                 std::string const& noMemory) {
  // The parent's worker threads do not exist here: loops that OpenVDB runs while it reads or gives up must
  // not wait for them.
  tbb::global_control const alone(tbb::global_control::max_allowed_parallelism, 1);
  verdictEnd = fd, memoryVerdict = &noMemory;
  std::set_new_handler(onNoMemory);
  prctl(PR_SET_PDEATHSIG, SIGKILL); // nobody waits for the verdict of an orphan
  // A sanitizer reserves address space by the terabyte; there the parent's watch over its memory is the
  // only bound.
  if (start.space < (std::uint64_t(1) << 40)) {
    // Without room for a stack even the verdict that there is no memory would fail.
    std::uint64_t const space = start.space + std::max(limits.memoryBytes, kStackRoom);
    setLimit(RLIMIT_AS, space, space);
  }
  setLimit(RLIMIT_CPU, limits.seconds, limits.seconds + 1);
  setLimit(RLIMIT_CORE, 0, 0);
  for (int n : {SIGSEGV, SIGBUS, SIGFPE, SIGILL, SIGABRT, SIGXCPU, SIGTERM, SIGINT}) signal(n, SIG_DFL);
  // What OpenVDB has to say about the file is the business of the real reading.
  int const null = open("/dev/null", O_RDWR);
  if (null >= 0)
    for (int n = 0; n < 3; ++n) dup2(null, n);
  try {
    std::shared_ptr<void> const content = read();
    // The parent may not have looked since: a child can be quicker than the watch.
    writeAll(fd, memoryOf("self").own > start.own + limits.memoryBytes ? noMemory : "ok");
    _exit(0);
  } catch (...) { writeAll(fd, readFailure(limits.memoryBytes)); }
}

// The child's whole life. It never returns, whatever is thrown: what left this function would go on as a
// second copy of the parent.
// @param noMemory Made before the fork: the child may have no memory for it.
[[noreturn]] void runChild(ReadInChild const& read, VdbReadLimits const& limits, Memory const& start, int fd,
                           std::string const& noMemory) noexcept {
  try {
    readInChild(read, limits, start, fd, noMemory);
  } catch (...) { writeAll(fd, noMemory); }
  _exit(0);
}

// The parent's side. Where watching ends early, by what is thrown, the child ends too.
struct Child {
  int end = -1;
  pid_t process = -1;

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

VdbReadLimits effective(VdbReadLimits limits, std::uint64_t fileSize) {
  if (limits.memoryBytes == 0) limits.memoryBytes = availableMemory() / 4 * 3;
  if (limits.seconds == 0)
    limits.seconds = static_cast<unsigned>(10 + std::min<std::uint64_t>(fileSize / kMB, 100000));
  return limits;
}

// Reads the file in one child.
// @return Whether it stalled, and nothing is known of the file.
bool probeOnce(std::string const& path, ReadInChild const& read, VdbReadLimits const& limits,
               double stallSeconds) {
  Memory const start = memoryOf("self");
  std::string const noMemory = memoryReason(limits.memoryBytes);
  int ends[2];
  if (pipe2(ends, O_CLOEXEC) != 0) throw FileError(path, std::string("no pipe: ") + std::strerror(errno));
  Child child{ends[0], fork()};
  int const error = errno;
  if (child.process == 0) runChild(read, limits, start, ends[1], noMemory);
  close(ends[1]);
  if (child.process < 0)
    throw FileError(path, std::string("no process to read it in: ") + std::strerror(error));
  Verdict verdict = watchChild(child.end, child.process, limits, start, stallSeconds);
  int const status = child.wait();
  if (verdict.stalled && !verdict.reason) return true;
  if (verdict.reason) throw FileError(path, *verdict.reason);
  if (WIFSIGNALED(status)) {
    int const number = WTERMSIG(status);
    if (number == SIGXCPU || number == SIGKILL)
      throw FileError(path, "is damaged, or takes more than " + std::to_string(limits.seconds) +
                                " s of processor time");
    throw FileError(path, std::string("is damaged: reading it ends in \"") + strsignal(number) + "\"");
  }
  if (verdict.text.empty()) throw FileError(path, "is damaged: reading it ends without a word");
  if (verdict.text != "ok") throw FileError(path, verdict.text);
  return false;
}

// Probes and returns the limits in force.
VdbReadLimits probe(std::string const& path, VdbReadLimits const& asked) {
  return probeInChild(path, asked, checkHeader(path),
                      [&] { return std::make_shared<VdbFile>(readWhole(path)); });
}

} // namespace

std::uint64_t regularFileSize(std::string const& path) {
  struct stat info;
  if (stat(path.c_str(), &info) != 0) throw FileError(path, std::strerror(errno));
  if (S_ISDIR(info.st_mode)) throw FileError(path, "is a directory");
  // A pipe or a device might never end, and cannot be read twice.
  if (!S_ISREG(info.st_mode)) throw FileError(path, "is not a regular file");
  if (std::ifstream in(path, std::ios::binary); !in)
    throw FileError(path, std::string("cannot be opened: ") + std::strerror(errno));
  if (info.st_size == 0) throw FileError(path, "is empty");
  return static_cast<std::uint64_t>(info.st_size);
}

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

VdbReadLimits probeInChild(std::string const& path, VdbReadLimits const& asked, std::uint64_t fileSize,
                           ReadInChild const& read) {
  VdbReadLimits const limits = effective(asked, fileSize);
  openvdb::initialize();
  // A worker thread that happened to hold one of the scheduler's locks while the child was made does not
  // exist in the child, which then waits for ever. Another child will not have that bad luck. One that waits
  // for a slow disk looks the same, so that each has more time than the one before.
  for (double stallSeconds = 0.25; probeOnce(path, read, limits, stallSeconds); stallSeconds *= 2) {}
  return limits;
}

void probeVdbFile(std::string const& path, VdbReadLimits const& limits) { probe(path, limits); }

VdbFile readVdbFile(std::string const& path, VdbReadLimits const& asked) {
  VdbReadLimits const limits = probe(path, asked);
  try {
    VdbFile file = readWhole(path);
    file.memoryBytes = limits.memoryBytes;
    return file;
  } catch (...) { throw FileError(path, readFailure(limits.memoryBytes)); }
}

char const* openvdbVersion() { return openvdb::getLibraryVersionString(); }

} // namespace VLN::Interop
