// The program goes on as the process that read its file, and the one that was started waits for it.
#include "support/VlnProgram.h"

#include <algorithm>
#include <csignal>
#include <filesystem>
#include <fstream>
#include <iterator>

namespace VLN::Test {
namespace {

/// The children of a process.
std::vector<pid_t> childrenOf(pid_t process) {
  std::string const id = std::to_string(process);
  std::ifstream in("/proc/" + id + "/task/" + id + "/children");
  return {std::istream_iterator<pid_t>(in), {}};
}

bool isThere(pid_t process) {
  std::ifstream in("/proc/" + std::to_string(process) + "/stat");
  std::string id, name, state;
  return (in >> id >> name >> state) && state != "Z";
}

class SupervisorTest : public testing::Test {
protected:
  SupervisorTest() {
    EXPECT_EQ(vln({"make", "cloud", m_sound, "--voxels", "1000000"}).code, 0);
    // Metadata of a type that OpenVDB takes as it is: such a file is read in a child.
    std::string bytes = readAll(m_sound);
    std::string const name("file_compression\x06\0\0\0string", 26);
    std::size_t const at = bytes.find(name);
    EXPECT_NE(at, std::string::npos);
    if (at != std::string::npos) bytes[at + 24] = 'm';
    writeAll(m_cloud, bytes);
  }

  pid_t start(std::string const& input) {
    pid_t const process = fork();
    if (process == 0) {
      int const null = open("/dev/null", O_RDWR);
      for (int n = 0; n < 3; ++n) dup2(null, n);
      execl(VLN_PROGRAM, VLN_PROGRAM, "convert", input.c_str(), m_output.c_str(), nullptr);
      _exit(127);
    }
    return process;
  }
  std::size_t fileCount() const {
    return static_cast<std::size_t>(std::distance(std::filesystem::directory_iterator(m_folder / ""),
                                                  std::filesystem::directory_iterator()));
  }

  TempFolder m_folder, m_inputs;
  std::string const m_cloud = m_inputs / "cloud.vdb", m_output = m_folder / "out.vdb";
  std::string const m_sound = m_inputs / "sound.vdb"; ///< for which this process needs no other
};

// requirement: a signal to the process that was started ends the one that works too, by the same signal, and
// leaves no part of a file, whenever it comes
TEST_F(SupervisorTest, SignalsReachWhoeverWorks) {
  int ended = 0;
  for (int delay : {5, 20, 60, 120, 180, 240, 300}) {
    for (int number : {SIGTERM, SIGINT, SIGHUP}) {
      bool const sound = number == SIGINT;
      std::filesystem::remove(m_output);
      pid_t const process = start(sound ? m_sound : m_cloud);
      usleep(static_cast<useconds_t>(delay) * 1000);
      auto const children = childrenOf(process);
      EXPECT_LE(children.size(), sound ? 0u : 1u);
      kill(process, number);
      int status = 0;
      ASSERT_EQ(waitpid(process, &status, 0), process);
      for (int n = 0; n < 200 && !children.empty() && isThere(children[0]); ++n) usleep(10000);
      EXPECT_TRUE(children.empty() || !isThere(children[0]));
      if (WIFSIGNALED(status)) {
        ++ended;
        EXPECT_EQ(WTERMSIG(status), number);
        // The whole file may have its name already.
        bool const isWhole = std::filesystem::exists(m_output);
        EXPECT_EQ(fileCount(), isWhole ? 1u : 0u) << "after " << delay << " ms";
        if (isWhole) { EXPECT_EQ(vln({"info", "--brief", m_output}).code, 0); }
      } else {
        EXPECT_EQ(WEXITSTATUS(status), 0); // it was done
        EXPECT_EQ(fileCount(), 1u);
      }
    }
  }
  EXPECT_GT(ended, 3);
}

// requirement: killed without mercy, it leaves no process behind
TEST_F(SupervisorTest, NoProcessOutlivesTheProgram) {
  pid_t const process = start(m_cloud);
  std::vector<pid_t> children;
  // A sanitized program beside others takes seconds to begin.
  for (int n = 0; n < 10000 && children.empty(); ++n) {
    usleep(2000);
    children = childrenOf(process);
  }
  ASSERT_EQ(children.size(), 1u);
  kill(process, SIGKILL);
  int status = 0;
  ASSERT_EQ(waitpid(process, &status, 0), process);
  for (int n = 0; n < 300 && isThere(children[0]); ++n) usleep(10000);
  EXPECT_FALSE(isThere(children[0]));
}

// requirement: codes and output are those of the work: several files, one of them damaged
TEST_F(SupervisorTest, EndsAsTheWorkDoes) {
  std::string const damaged = m_inputs / "damaged.vdb";
  std::string bytes = readAll(m_cloud);
  std::ofstream(damaged, std::ios::binary) << bytes.substr(0, bytes.size() / 2);
  auto const good = vln({"info", "--brief", m_cloud});
  EXPECT_EQ(good.code, 0);
  EXPECT_EQ(good.err, "");
  for (auto const& files : {std::vector<std::string>{damaged, m_cloud}, {m_cloud, damaged}}) {
    auto const run = vln({"info", "--brief", files[0], files[1]});
    EXPECT_EQ(run.code, 1);
    EXPECT_NE(run.out.find("cloud.vdb"), std::string::npos);
    EXPECT_EQ(std::count(run.err.begin(), run.err.end(), '\n'), 1) << run.err;
    EXPECT_NE(run.err.find("damaged.vdb"), std::string::npos);
  }
}

} // namespace
} // namespace VLN::Test
