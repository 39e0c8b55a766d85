#include "GeometryVolume/core/LogPathImpl.h"

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <gtest/gtest.h>
#include <optional>
#include <regex>
#include <set>
#include <string>
#include <unistd.h>

namespace {

namespace fs = std::filesystem;
using VLN::Utils::createLogPath;

/// Takes the variables away, and puts them back at the end.
class LogPath : public ::testing::Test {
protected:
  LogPath() {
    for (std::size_t i = 0; i < 3; ++i) {
      if (char const* value = std::getenv(kVariables[i])) m_before[i] = value;
      unsetenv(kVariables[i]);
    }
  }
  ~LogPath() override {
    for (std::size_t i = 0; i < 3; ++i)
      m_before[i] ? setenv(kVariables[i], m_before[i]->c_str(), 1) : unsetenv(kVariables[i]);
  }
  static constexpr char const* kVariables[] = {"TEMP", "tmp", "temp"};
  std::optional<std::string> m_before[3];
};

TEST_F(LogPath, RequirementNameAndUniquePartInTheTemporaryDirectory) {
  setenv("TEMP", "/somewhere", 1);
  std::string const path = createLogPath("tree.log");
  EXPECT_TRUE(std::regex_match(path, std::regex("/somewhere/vlndump[A-Za-z0-9]{6}_tree\\.log"))) << path;
}

TEST_F(LogPath, RequirementTheFirstVariableThatIsSet) {
  setenv("temp", "/third", 1);
  EXPECT_EQ(fs::path(createLogPath("a")).parent_path(), "/third");
  setenv("tmp", "/second", 1);
  EXPECT_EQ(fs::path(createLogPath("a")).parent_path(), "/second");
  setenv("TEMP", "/first", 1);
  EXPECT_EQ(fs::path(createLogPath("a")).parent_path(), "/first");
}

TEST_F(LogPath, BoundaryWithoutVariablesTheSystemsDirectory) {
  fs::path const system = fs::temp_directory_path();
  EXPECT_EQ(fs::path(createLogPath("a")).parent_path(), system);
}

TEST_F(LogPath, RegressionAnEmptyVariableIsSetTheSameAsAnyOther) {
  setenv("temp", "/third", 1);
  setenv("TEMP", "", 1);
  std::string const path = createLogPath("a");
  EXPECT_TRUE(std::regex_match(path, std::regex("vlndump[A-Za-z0-9]{6}_a"))) << path;
}

TEST_F(LogPath, BoundaryNamesWithFoldersAndWithout) {
  setenv("TEMP", "/somewhere", 1);
  std::string path = createLogPath("/var/log/../tree.log");
  EXPECT_TRUE(std::regex_match(path, std::regex("/somewhere/vlndump[A-Za-z0-9]{6}_tree\\.log"))) << path;
  path = createLogPath("");
  EXPECT_TRUE(std::regex_match(path, std::regex("/somewhere/vlndump[A-Za-z0-9]{6}"))) << path;
}

TEST_F(LogPath, RequirementPathsDifferAndNoFileIsMade) {
  fs::path const directory = fs::temp_directory_path() / ("vln_log_" + std::to_string(::getpid()));
  fs::create_directories(directory);
  setenv("TEMP", directory.c_str(), 1);
  std::set<std::string> paths;
  for (int i = 0; i < 100; ++i) paths.insert(createLogPath("x"));
  EXPECT_EQ(paths.size(), 100u);
  EXPECT_TRUE(fs::is_empty(directory));
  fs::remove_all(directory);
}

} // namespace
