// Reacts to lines of a pool's log: when the pool says that it removes something, the pretended control group
// can say at that moment how much is free.
#pragma once

#include "ControlGroup.h"
#include "CoutCapture.h"

#include <deque>
#include <functional>
#include <gtest/gtest.h>
#include <string>
#include <utility>

namespace test {

constexpr std::uint64_t kMB = std::uint64_t(1) << 20;

/// Actions in order; each waits for the first line that begins with its text after the action before it.
class PoolScript {
public:
  PoolScript& on(std::string line, std::function<void()> action) {
    m_steps.emplace_back(std::move(line), std::move(action));
    return *this;
  }
  /// `megabytes` are free from that line on.
  PoolScript& free(std::string line, double megabytes) {
    return on(std::move(line),
              [this, megabytes] { group.setFree(static_cast<std::uint64_t>(megabytes * double(kMB))); });
  }
  PoolScript& unreadable(std::string line) {
    return on(std::move(line), [this] { group.makeUnreadable(); });
  }
  /// Whether every action has run.
  bool done() const { return m_steps.empty(); }

  ControlGroup group;

private:
  void hear(std::string const& line) {
    if (m_steps.empty() || !line.starts_with(m_steps.front().first)) return;
    auto const action = std::move(m_steps.front().second);
    m_steps.pop_front();
    action();
  }
  std::deque<std::pair<std::string, std::function<void()>>> m_steps;

public:
  CoutCapture out{[this](std::string const& line) { hear(line); }};
};

} // namespace test
