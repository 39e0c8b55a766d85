#pragma once

#include "Interop/Progress.h"

#include <chrono>

namespace Vln {

/// One line on standard error that shows how far the work is, on a terminal only, and not for work that is
/// over at once. It is wiped at the end.
class ProgressBar {
public:
  ProgressBar();
  ProgressBar(ProgressBar const&) = delete;
  ProgressBar& operator=(ProgressBar const&) = delete;
  ~ProgressBar();

  void show(char const* stage, double done);
  /// For the calls that report. Empty when nothing would be seen.
  VLN::Interop::Progress progress();

private:
  using Clock = std::chrono::steady_clock;

  bool m_terminal;
  bool m_drawn = false;
  Clock::time_point m_next;
};

} // namespace Vln
