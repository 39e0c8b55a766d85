#include "GeometryVolume/pools/PoolUtils.h"

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <gtest/gtest.h>
#include <unistd.h>

namespace {

using namespace VLN::TileTree3D::PoolUtils;
namespace fs = std::filesystem;

TEST(ToMB, Requirement) {
  EXPECT_EQ(toMB(1048576), 1.0f);
  EXPECT_EQ(toMB(0), 0.0f);
  EXPECT_EQ(toMB(std::uint64_t(3) << 30), 3072.0f);
  EXPECT_EQ(toMB(std::uint64_t(1) << 63), 8796093022208.0f);
}

/// A temporary directory that plays the control group.
class ControlGroup : public ::testing::Test {
protected:
  ControlGroup()
      : m_before(cgroupPath())
      , m_directory(fs::temp_directory_path() / ("vln_cgroup_" + std::to_string(::getpid()))) {
    fs::create_directories(m_directory);
    setCgroupPath("");
    m_readable = getMemoryStats(m_machine);
    setCgroupPath(m_directory.string());
  }
  ~ControlGroup() override {
    setCgroupPath(m_before);
    fs::remove_all(m_directory);
  }
  void put(char const* name, std::string const& text) { std::ofstream(m_directory / name) << text << '\n'; }
  MemoryStats stats() {
    MemoryStats s{1, 2};
    EXPECT_TRUE(getMemoryStats(s));
    return s;
  }
  void expectNoFigures() {
    MemoryStats s{1, 2};
    EXPECT_FALSE(getMemoryStats(s));
    EXPECT_EQ(s.totalPhysical, 1u);
    EXPECT_EQ(s.availablePhysical, 2u);
  }

  std::string m_before;
  fs::path m_directory;
  MemoryStats m_machine{};
  bool m_readable = false;
};

TEST_F(ControlGroup, RequirementMachineFiguresAreSane) {
  ASSERT_TRUE(m_readable);
  EXPECT_GT(m_machine.totalPhysical, std::uint64_t(64) << 20);
  EXPECT_LE(m_machine.availablePhysical, m_machine.totalPhysical);
}

TEST_F(ControlGroup, RequirementVersion2LimitNarrowsBoth) {
  put("memory.max", "67108864");
  put("memory.current", "1048576");
  EXPECT_EQ(stats().totalPhysical, 67108864u);
  EXPECT_EQ(stats().availablePhysical, 66060288u);
}

TEST_F(ControlGroup, RequirementVersion1LimitNarrowsBoth) {
  put("memory.limit_in_bytes", "33554432");
  put("memory.usage_in_bytes", "33554431");
  EXPECT_EQ(stats().totalPhysical, 33554432u);
  EXPECT_EQ(stats().availablePhysical, 1u);
}

TEST_F(ControlGroup, BoundaryNoLimitNarrowsNothing) {
  EXPECT_EQ(stats().totalPhysical, m_machine.totalPhysical);
  put("memory.max", "max");
  put("memory.current", "1048576");
  EXPECT_EQ(stats().totalPhysical, m_machine.totalPhysical);
  fs::remove(m_directory / "memory.max");
  put("memory.limit_in_bytes", "9223372036854771712");
  EXPECT_EQ(stats().totalPhysical, m_machine.totalPhysical);
  put("memory.limit_in_bytes", "99999999999999999999999");
  EXPECT_EQ(stats().totalPhysical, m_machine.totalPhysical);
}

TEST_F(ControlGroup, BoundaryUsageBeyondTheLimitLeavesNothing) {
  put("memory.max", "1048576");
  put("memory.current", "2097152");
  EXPECT_EQ(stats().availablePhysical, 0u);
}

TEST_F(ControlGroup, RequirementAProcessLimitCountsWhatIsResident) {
  std::uint64_t const resident = residentMemory();
  ASSERT_GT(resident, std::uint64_t(1) << 20);
  setProcessLimit(resident + (std::uint64_t(16) << 20));
  MemoryStats const s = stats();
  EXPECT_LE(s.totalPhysical, resident + (std::uint64_t(16) << 20));
  EXPECT_LE(s.availablePhysical, std::uint64_t(17) << 20);
  EXPECT_GE(s.availablePhysical, std::uint64_t(12) << 20);
  setProcessLimit(1);
  EXPECT_EQ(stats().availablePhysical, 0u);
  setProcessLimit(0);
  EXPECT_EQ(processLimit(), 0u);
  EXPECT_EQ(stats().totalPhysical, m_machine.totalPhysical);
}

TEST_F(ControlGroup, NegativeUnreadableGroupGivesNoFigures) {
  put("memory.max", "lots");
  expectNoFigures();
  put("memory.max", "");
  expectNoFigures();
  for (auto const* text : {"12x", "12 x", "0x12", "1e9", "67108864 kB", "6710 8864", "-1"}) {
    SCOPED_TRACE(text);
    put("memory.max", text);
    expectNoFigures();
  }
  setCgroupPath((m_directory / "missing").string());
  expectNoFigures();
}

} // namespace
