#include "GeometryVolume/core/Version.h"

#include <gtest/gtest.h>

#include <cstdio>
#include <filesystem>
#include <regex>
#include <string>

// requirement
TEST(Version, TellsWhatTheLibraryWasMadeFrom) {
  const VLN::VersionInfo& info = VLN::versionInfo();
  EXPECT_GE(info.majorNumber, 0);
  EXPECT_GE(info.minorNumber, 0);
  EXPECT_TRUE(std::regex_match(info.buildDate, std::regex(R"(\d{4}-\d{2}-\d{2})"))) << info.buildDate;
  EXPECT_TRUE(std::regex_match(info.build, std::regex(R"(\d+)"))) << info.build;
  EXPECT_TRUE(std::regex_match(info.commit, std::regex("[0-9a-f]{12,}|unknown"))) << info.commit;
  EXPECT_FALSE(std::string(info.branch).empty());
}

namespace {

/// What this very program writes to its two streams, started anew with `environment`.
std::string output(std::string const& environment, std::string const& redirection) {
  std::string const command = environment + " '" + std::filesystem::read_symlink("/proc/self/exe").string() +
                              "' --gtest_list_tests --gtest_filter=None " + redirection;
  std::string text;
  FILE* const pipe = popen(command.c_str(), "r");
  char buffer[256];
  while (pipe && std::fgets(buffer, sizeof(buffer), pipe)) text += buffer;
  EXPECT_EQ(pclose(pipe), 0) << command;
  return text;
}

constexpr char const* kOnlyErrors = "2>&1 >/dev/null";

} // namespace

// requirement
TEST(VersionBanner, IsWrittenToStandardErrorAtLoadWhenAsked) {
  std::string const line = output("KERRATE_DUMP_VERSION_INFO=1", kOnlyErrors);
  EXPECT_EQ(line, "  GeometryVolume: " + VLN::versionBanner() + "\n");
  EXPECT_TRUE(std::regex_match(
      VLN::versionBanner(),
      std::regex(R"([A-Za-z]+ version \d+\.\d+ \d{4}-\d{2}-\d{2}, build \d+, commit \w+, branch \S+)")))
      << VLN::versionBanner();
}

// negative
TEST(VersionBanner, IsNotWrittenOtherwise) {
  EXPECT_EQ(output("KERRATE_DUMP_VERSION_INFO=0", kOnlyErrors), "");
  EXPECT_EQ(output("KERRATE_DUMP_VERSION_INFO=yes", kOnlyErrors), "");
  EXPECT_EQ(output("", kOnlyErrors), "");
  EXPECT_FALSE(VLN::versionBannerAsked());
}

// boundary
TEST(VersionBanner, NeedsAnErrorStream) {
  EXPECT_EQ(output("KERRATE_DUMP_VERSION_INFO=1", "2>&- >/dev/null"), "");
}
