#include "ProgressBar.h"

#include <algorithm>
#include <cmath>
#include <cstdio>
#include <string>

#include <unistd.h>

namespace Vln {

namespace {

constexpr auto kFirst = std::chrono::milliseconds(150), kStep = std::chrono::milliseconds(50);
constexpr int kWidth = 32;
// Before that a guess at the rest is not worth its place.
constexpr double kGuessAfter = 1;

// ", 3 s left", once there is something to judge by.
std::string timeLeft(double seconds, double share) {
  if (seconds < kGuessAfter || share < 0.02 || share >= 1) return "";
  double const left = seconds * (1 - share) / share;
  if (left < 99.5) return ", " + std::to_string(std::lround(std::max(left, 1.0))) + " s left";
  return ", " + std::to_string(std::lround(left / 60)) + " min left";
}

} // namespace

ProgressBar::ProgressBar()
    : m_terminal(isatty(STDERR_FILENO) == 1)
    , m_start(Clock::now())
    , m_next(m_start + kFirst) {}

ProgressBar::~ProgressBar() {
  if (m_drawn) std::fputs("\r\033[K", stderr);
}

void ProgressBar::show(char const* stage, double done) {
  if (!m_terminal) return;
  m_share = std::clamp(done, m_share, 1.0);
  auto const now = Clock::now();
  if (now < m_next) return;
  m_next = now + kStep;
  std::string bar(kWidth, '.');
  std::fill_n(bar.begin(), static_cast<int>(m_share * kWidth), '#');
  double const seconds = std::chrono::duration<double>(now - m_start).count();
  std::fprintf(stderr, "\r[%s] %3d %%  %s%s\033[K", bar.c_str(), static_cast<int>(100 * m_share), stage,
               timeLeft(seconds, m_share).c_str());
  m_drawn = true;
}

VLN::Interop::Progress ProgressBar::progress(double from, double to) {
  if (!m_terminal) return {};
  return [=, this](char const* stage, double done) { show(stage, from + (to - from) * done); };
}

} // namespace Vln
