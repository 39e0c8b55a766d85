#pragma once

#include "CoutCapture.h"
#include "GeometryVolume/core/Base.h"
#include "GeometryVolume/pools/BaseLogger.h"

#include <cstdint>
#include <gtest/gtest.h>
#include <string>

namespace test {

using VLN::Base;
using VLN::BaseLogger;

/// The logger on and empty; empty and off again at the end.
class LoggerTest : public ::testing::Test {
protected:
  LoggerTest() {
    BaseLogger::enable();
    BaseLogger::clear();
  }
  ~LoggerTest() override {
    BaseLogger::setTracedName("");
    BaseLogger::enable();
    BaseLogger::clear();
    BaseLogger::disable();
  }
  /// A counter, as the report gives it.
  static int counter(std::string const& name) {
    CoutCapture report;
    BaseLogger::dump();
    std::string const value = report.after(" " + name + " = ");
    return value == "(no line)" ? -1 : std::stoi(value);
  }

  CoutCapture out;
};

/// An object of a known size.
class Sized : public Base {
public:
  Sized(std::string const& name, std::uint64_t used, std::uint64_t allocated)
      : Base(name)
      , m_used(used)
      , m_allocated(allocated) {}
  void memUse(std::uint64_t& used, std::uint64_t& allocated, bool) const override {
    used = m_used, allocated = m_allocated;
  }

private:
  std::uint64_t m_used, m_allocated;
};

/// An address that stands for a block.
inline void const* block(int n) {
  return reinterpret_cast<void const*>(static_cast<std::uintptr_t>(4096 * n));
}

} // namespace test
