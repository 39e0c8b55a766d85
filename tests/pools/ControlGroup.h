// A temporary directory that plays a control group, so that a test says how much memory is free.
#pragma once

#include "GeometryVolume/pools/PoolUtils.h"

#include <atomic>
#include <cstdint>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <string>
#include <unistd.h>

namespace test {

class ControlGroup {
public:
  static constexpr std::uint64_t kLimit = std::uint64_t(64) << 20;

  ControlGroup()
      : m_before(VLN::TileTree3D::PoolUtils::cgroupPath())
      , m_directory(std::filesystem::temp_directory_path() /
                    ("vln_group_" + std::to_string(::getpid()) + "_" + std::to_string(s_count++))) {
    std::filesystem::create_directories(m_directory);
    put("memory.max", std::to_string(kLimit));
    setFree(kLimit);
    VLN::TileTree3D::PoolUtils::setCgroupPath(m_directory.string());
  }
  ~ControlGroup() {
    VLN::TileTree3D::PoolUtils::setCgroupPath(m_before);
    std::filesystem::remove_all(m_directory);
  }
  ControlGroup(ControlGroup const&) = delete;
  ControlGroup& operator=(ControlGroup const&) = delete;

  /// From now on this many bytes are free.
  void setFree(std::uint64_t bytes) { put("memory.current", std::to_string(kLimit - bytes)); }
  /// From now on the figures cannot be read.
  void makeUnreadable() { put("memory.current", "gone"); }
  std::string path() const { return m_directory.string(); }

private:
  /// At once, as a kernel would: a reader in another thread sees the old text or the new one.
  void put(char const* name, std::string const& text) {
    auto const beside = m_directory / "next";
    std::ofstream(beside) << text << '\n';
    std::filesystem::rename(beside, m_directory / name);
  }

  inline static std::atomic<int> s_count{0};
  std::string m_before;
  std::filesystem::path m_directory;
};

} // namespace test
