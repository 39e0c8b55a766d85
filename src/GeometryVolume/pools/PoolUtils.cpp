#include "GeometryVolume/pools/PoolUtils.h"

#include "GeometryVolume/pools/PoolLogImpl.h"

#include <algorithm>
#include <atomic>
#include <charconv>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <mutex>
#include <optional>
#include <stdexcept>
#include <string>
#include <string_view>
#include <unistd.h>

namespace VLN::TileTree3D::PoolUtils {

namespace {

/// Constructed on first use and never destroyed: pools ask for figures while the process ends.
struct Environment {
  std::mutex mutex;
  Ostil::String cgroupPath;
  bool logging = false;

  Environment() {
    if (char const* flag = std::getenv("VELORN_ENABLE_VLN_POOL_UTILS_LOGGING"))
      logging = std::atoi(flag) != 0;
    if (char const* path = std::getenv("VELORN_CGROUP_PATH")) cgroupPath = path;
  }
};

Environment& environment() {
  static Environment* const e = new Environment;
  return *e;
}
[[maybe_unused]] Environment const& g_readAtLoad = environment();

/// The number that a text begins with; what may follow it is the caller's to say.
std::uint64_t parseBytes(std::string_view text, std::string_view unit = "") {
  auto const first = text.find_first_not_of(" \t");
  if (first == std::string_view::npos) throw std::runtime_error("no number");
  text.remove_prefix(first);
  std::uint64_t value = 0;
  auto const [end, error] = std::from_chars(text.data(), text.data() + text.size(), value);
  if (end == text.data()) throw std::runtime_error("no number");
  auto rest = text.substr(end - text.data());
  rest.remove_prefix(std::min(rest.size(), rest.find_first_not_of(" \t\r")));
  if (auto const last = rest.find_last_not_of(" \t\r"); last != rest.npos) rest = rest.substr(0, last + 1);
  if (rest != unit) throw std::runtime_error("no number");
  if (error == std::errc::result_out_of_range) return UINT64_MAX;
  return value;
}

MemoryStats machineStats() {
  std::ifstream file("/proc/meminfo");
  std::optional<std::uint64_t> total, available;
  for (std::string line; std::getline(file, line) && !(total && available);) {
    auto const value = [&](std::string_view key, std::optional<std::uint64_t>& out) {
      if (line.compare(0, key.size(), key) == 0)
        out = parseBytes(std::string_view(line).substr(key.size()), "kB") * 1024;
    };
    value("MemTotal:", total);
    value("MemAvailable:", available);
  }
  if (!total || !available) throw std::runtime_error("no memory figures");
  return {*total, *available};
}

/// First line of a file of the group; nothing when there is no such file.
std::optional<std::string> groupValue(std::filesystem::path const& directory, char const* name) {
  std::ifstream file(directory / name);
  if (!file) return {};
  std::string line;
  std::getline(file, line);
  return line;
}

constinit std::atomic<std::uint64_t> g_processLimit{0};

void narrow(MemoryStats& stats, std::uint64_t most, std::uint64_t usage) {
  stats.totalPhysical = std::min(stats.totalPhysical, most);
  stats.availablePhysical = std::min(stats.availablePhysical, most - std::min(most, usage));
}

void narrow(MemoryStats& stats, std::filesystem::path const& group) {
  if (!std::filesystem::is_directory(group)) throw std::runtime_error("no control group");
  auto limit = groupValue(group, "memory.max");
  char const* usageName = "memory.current";
  if (!limit) {
    limit = groupValue(group, "memory.limit_in_bytes");
    usageName = "memory.usage_in_bytes";
  }
  if (!limit || *limit == "max") return;
  std::uint64_t const most = parseBytes(*limit);
  auto const used = groupValue(group, usageName);
  narrow(stats, most, used ? parseBytes(*used) : 0);
}

} // namespace

bool getMemoryStats(MemoryStats& out) {
  bool const logging = loggingEnabled();
  try {
    MemoryStats stats = machineStats();
    if (auto const group = cgroupPath(); !group.empty()) narrow(stats, std::filesystem::path(group));
    if (auto const limit = processLimit()) narrow(stats, limit, residentMemory());
    out = stats;
    if (logging)
      Internal::writeLine("PoolUtils: total physical memory = ", toMB(stats.totalPhysical),
                          "MB, available physical memory = ", toMB(stats.availablePhysical), "MB");
    return true;
  } catch (...) {
    if (logging) Internal::writeLine("PoolUtils: unable to retrieve memory stats");
    return false;
  }
}

float toMB(std::uint64_t bytes) { return static_cast<float>(bytes) * 0.0009765625f * 0.0009765625f; }

bool loggingEnabled() { return environment().logging; }

Ostil::String cgroupPath() {
  auto& e = environment();
  std::lock_guard const lock(e.mutex);
  return e.cgroupPath;
}

void setCgroupPath(Ostil::String const& path) {
  auto& e = environment();
  std::lock_guard const lock(e.mutex);
  e.cgroupPath = path;
}

void setProcessLimit(std::uint64_t bytes) { g_processLimit.store(bytes, std::memory_order_relaxed); }
std::uint64_t processLimit() { return g_processLimit.load(std::memory_order_relaxed); }

std::uint64_t residentMemory() {
  std::ifstream file("/proc/self/statm");
  std::uint64_t total = 0, resident = 0;
  file >> total >> resident;
  return file ? resident * static_cast<std::uint64_t>(sysconf(_SC_PAGESIZE)) : 0;
}

} // namespace VLN::TileTree3D::PoolUtils
