#pragma once

#include "Interop/Progress.h"

#include <chrono>

namespace Vln {

/// One line on standard error that shows how far the work is and how long the rest may take, on a terminal
/// only, and not for work that is over at once. It never goes back, and is wiped at the end.
class ProgressBar {
public:
  ProgressBar();
  ProgressBar(ProgressBar const&) = delete;
  ProgressBar& operator=(ProgressBar const&) = delete;
  ~ProgressBar();

  void show(char const* stage, double done);
  /// For a call that reports from 0 to 1, and is a part of the whole work. Empty when nothing would be seen.
  VLN::Interop::Progress progress(double from = 0, double to = 1);

private:
  using Clock = std::chrono::steady_clock;

  bool m_terminal;
  bool m_drawn = false;
  double m_share = 0; ///< the most that was reported
  Clock::time_point m_start, m_next;
};

} // namespace Vln
