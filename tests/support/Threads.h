// Lets the scheduler make eight threads on any machine, so that tests at 2 and 8 threads are what they say.
// Included by one source of each test binary that runs parallel loops.
#pragma once

#include <gtest/gtest.h>
#include <tbb/global_control.h>

namespace Support {

class EightThreads : public ::testing::Environment {
  tbb::global_control m_limit{tbb::global_control::max_allowed_parallelism, 8};
};

inline auto* const g_eightThreads = ::testing::AddGlobalTestEnvironment(new EightThreads);

} // namespace Support
