// Replays the fuzzer's cases of filters without the fuzzer: seeds, and mutations of them.
#include "support/FilterCase.h"
#include "support/FuzzReplay.h"

#include <gtest/gtest.h>

namespace {

using Support::FilterCase;

std::vector<std::string> seeds() {
  std::vector<std::string> list = {
      "density temp* !temp_old/density/temp_old/temperature",
      "a b/c",
      "!a/a/b",
      "^tmp*/tmp1",
      "!!a *b*c* ***",
      "a.b a.* :x: _",
      "",
      " ",
      "!",
      "! a",
      "a$ b",
      "a!b",
      "ok !a$",
      std::string("a \0b", 4),
      "\xFF",
      "*a*b/a\nb/a\rb/ab",
      "a*a*a*a*a*a*a*b/aaaaaaaaaaaaaaaaaaaaaaaaaaaaaaaa",
      std::string(3000, '!') + "a",
      std::string(3000, '*') + "a/" + std::string(3000, 'a'),
      std::string(3000, 'a'),
  };
  std::string many;
  for (int n = 0; n < 500; ++n) many += "!a" + std::to_string(n) + "* ";
  list.push_back(many);
  return list;
}

TEST(FilterFuzz, RequirementSeedsMeanWhatANaiveReaderMakesOfThem) {
  Support::replay<FilterCase>("filter", seeds());
}

TEST(FilterFuzz, RequirementMutatedFiltersMeanWhatANaiveReaderMakesOfThem) {
  Support::replayMutations<FilterCase>(seeds(), 10000, "!^* \n/abx.:_$\xFF");
}

} // namespace
