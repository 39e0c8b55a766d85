#include "ProgressBar.h"

#include <algorithm>
#include <cstdio>
#include <string>

#include <unistd.h>

namespace Vln {

namespace {

constexpr auto kFirst = std::chrono::milliseconds(150), kStep = std::chrono::milliseconds(50);
constexpr int kWidth = 32;

} // namespace

ProgressBar::ProgressBar()
    : m_terminal(isatty(STDERR_FILENO) == 1)
    , m_next(Clock::now() + kFirst) {}

ProgressBar::~ProgressBar() {
  if (m_drawn) std::fputs("\r\033[K", stderr);
}

void ProgressBar::show(char const* stage, double done) {
  if (!m_terminal || Clock::now() < m_next) return;
  m_next = Clock::now() + kStep;
  double const share = std::clamp(done, 0.0, 1.0);
  std::string bar(kWidth, '.');
  std::fill_n(bar.begin(), static_cast<int>(share * kWidth), '#');
  std::fprintf(stderr, "\r[%s] %3d %%  %s\033[K", bar.c_str(), static_cast<int>(100 * share), stage);
  m_drawn = true;
}

VLN::Interop::Progress ProgressBar::progress() {
  if (!m_terminal) return {};
  return [this](char const* stage, double done) { show(stage, done); };
}

} // namespace Vln
