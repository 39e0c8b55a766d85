// Replays the fuzzer's sequences of operations without the fuzzer.
#include "support/FuzzReplay.h"
#include "support/OperationsCase.h"

namespace {

using Support::OperationsCase;

std::vector<std::string> seeds() {
  std::vector<std::string> list;
  std::mt19937 random(5);
  for (std::size_t n = 0; n < 40; ++n) {
    std::string bytes(40 + n * 20, '\0');
    for (char& b : bytes) b = static_cast<char>(random());
    bytes[0] = static_cast<char>(n % 2);
    list.push_back(bytes);
  }
  return list;
}

TEST(OperationsFuzz, RequirementSequencesAgreeWithTheModels) {
  Support::replay<OperationsCase>("operations", seeds());
}

TEST(OperationsFuzz, RequirementMutatedSequencesAgreeWithTheModels) {
  char const* const count = std::getenv("VLN_TEST_OPERATIONS");
  Support::replayMutations<OperationsCase>(seeds(), count ? std::atoi(count) : 200, "");
}

} // namespace
