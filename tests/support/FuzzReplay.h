// The plain driver behind the fuzzers' tests: runs their cases one after the other. With FUZZ_SEEDS naming a
// folder, seeds are also written there for scripts/fuzz.sh; the files of a folder named by FUZZ_CORPUS are
// run as seeds.
#pragma once

#include "support/FuzzCheck.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <random>
#include <string>
#include <vector>

namespace Support {

template <class Case> bool runCase(std::string const& bytes) {
  // An allocation of exactly this size: a sanitizer sees each step beyond the end.
  std::vector<std::uint8_t> const copy(bytes.begin(), bytes.end());
  return Case(copy.data(), copy.size()).run();
}

inline std::string shownCase(std::string const& bytes) {
  static char const* const kHex = "0123456789abcdef";
  std::string text;
  for (char const c : bytes.substr(0, 2000)) {
    auto const b = static_cast<unsigned char>(c);
    if (b >= 32 && b < 127 && c != '\\')
      text += c;
    else
      text += std::string("\\x") + kHex[b / 16] + kHex[b % 16];
  }
  return text;
}

/// Runs every seed.
template <class Case> void replay(std::string const& name, std::vector<std::string> seeds) {
  if (char const* const corpus = std::getenv("FUZZ_CORPUS")) {
    for (auto const& file : std::filesystem::directory_iterator(corpus)) {
      std::ifstream in(file.path(), std::ios::binary);
      seeds.emplace_back(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
    }
  }
  char const* const folder = std::getenv("FUZZ_SEEDS");
  int n = 0;
  for (std::string const& seed : seeds) {
    try {
      runCase<Case>(seed);
    } catch (FuzzFailure const& failure) { ADD_FAILURE() << failure.what(); }
    ASSERT_FALSE(::testing::Test::HasFailure()) << "seed " << n << ": " << shownCase(seed);
    if (folder) std::ofstream(std::string(folder) + "/" + name + std::to_string(n), std::ios::binary) << seed;
    ++n;
  }
}

/// One or a few random changes: of a byte, of a run of bytes, of two seeds joined.
template <class Random>
std::string mutated(std::string bytes, std::vector<std::string> const& seeds, std::string const& alphabet,
                    Random& random) {
  auto const below = [&](std::size_t n) { return static_cast<std::size_t>(random() % (n + !n)); };
  for (auto times = 1 + random() % 4; times; --times) {
    std::size_t const at = below(bytes.size() + 1);
    std::size_t const count = std::min(bytes.size() - at, below(8));
    switch (random() % 6) {
    case 0:
      if (at < bytes.size()) bytes[at] = static_cast<char>(random());
      break;
    case 1:
      if (!alphabet.empty()) bytes.insert(at, 1, alphabet[below(alphabet.size())]);
      break;
    case 2:
      bytes.erase(at, count);
      break;
    case 3:
      bytes.insert(at, bytes.substr(at, count));
      break;
    case 4: {
      std::string const& other = seeds[below(seeds.size())];
      std::size_t const from = below(other.size());
      bytes.insert(at, other, from, below(64));
      break;
    }
    default:
      if (at < bytes.size()) bytes[at] = static_cast<char>(bytes[at] ^ (1 << random() % 8));
    }
  }
  return bytes;
}

template <class Case>
void replayMutations(std::vector<std::string> const& seeds, int cases, std::string const& alphabet,
                     std::uint32_t first = 1) {
  std::mt19937 random(first);
  int accepted = 0;
  for (int n = 0; n < cases; ++n) {
    std::string const bytes = mutated(seeds[random() % seeds.size()], seeds, alphabet, random);
    try {
      accepted += runCase<Case>(bytes);
    } catch (FuzzFailure const& failure) { ADD_FAILURE() << failure.what(); }
    ASSERT_FALSE(::testing::Test::HasFailure()) << "case " << n << ": " << shownCase(bytes);
  }
  EXPECT_GT(accepted, cases / 100) << "hardly any case is accepted: they do not reach far";
}

} // namespace Support
