#include "GeometryVolume/utils/WildcardMatch.h"

#include <gtest/gtest.h>

#include <random>
#include <regex>
#include <string>

namespace {

using VLN::Utils::wildcardMatch;

TEST(WildcardMatch, RequirementStarsStandForAnyRun) {
  EXPECT_TRUE(wildcardMatch("a*c", "ac"));
  EXPECT_TRUE(wildcardMatch("a*c", "abbc"));
  EXPECT_TRUE(wildcardMatch("a*b*c", "abbbc"));
  EXPECT_FALSE(wildcardMatch("a*c", "acb"));
  EXPECT_TRUE(wildcardMatch("*b*", "abc"));
  EXPECT_FALSE(wildcardMatch("*b*b*", "abc"));
  EXPECT_TRUE(wildcardMatch("**a**", "a"));
}

TEST(WildcardMatch, BoundaryHeadAndTailDoNotShareCharacters) {
  EXPECT_FALSE(wildcardMatch("ab*ba", "aba"));
  EXPECT_TRUE(wildcardMatch("ab*ba", "abba"));
  EXPECT_FALSE(wildcardMatch("a*a", "a"));
  EXPECT_TRUE(wildcardMatch("", ""));
  EXPECT_FALSE(wildcardMatch("", "a"));
  EXPECT_TRUE(wildcardMatch("*", ""));
}

/// The same pattern as a regular expression of the standard library.
bool regexMatch(std::string const& pattern, std::string const& name) {
  if (!pattern.empty() && pattern.find_first_not_of('*') == std::string::npos) return true;
  std::string text;
  for (char const c : pattern) text += c == '.' ? "\\." : c == '*' ? ".*" : std::string(1, c);
  return std::regex_match(name, std::regex(text));
}

TEST(WildcardMatch, RequirementMeansWhatTheRegularExpressionMeans) {
  std::uint32_t const seed = 20261121;
  std::mt19937 random(seed);
  auto const pick = [&](int low, int high) { return std::uniform_int_distribution<int>(low, high)(random); };
  int matches = 0;
  for (int n = 0; n < 20000; ++n) {
    std::string pattern, name;
    for (int k = pick(0, 7); k; --k) pattern += "aab.:_***"[pick(0, 8)];
    for (int k = pick(0, 9); k; --k) name += pick(0, 40) ? "aaab.:_"[pick(0, 6)] : "\n\r"[pick(0, 1)];
    bool const expected = regexMatch(pattern, name);
    matches += expected;
    ASSERT_EQ(wildcardMatch(pattern, name), expected)
        << "seed " << seed << ", case " << n << ": \"" << pattern << "\" on \"" << name << '"';
  }
  EXPECT_GT(matches, 1000);
}

} // namespace
