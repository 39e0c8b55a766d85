#include "GeometryVolume/core/Version.h"

#include <gtest/gtest.h>

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
