// Catches what is written to std::cout, line by line.
#pragma once

#include <functional>
#include <iostream>
#include <mutex>
#include <streambuf>
#include <string>
#include <utility>
#include <vector>

namespace test {

/// Keeps the lines, and shows each to a listener at the moment it is written.
class CoutCapture final : private std::streambuf {
public:
  using Listener = std::function<void(std::string const& line)>;

  explicit CoutCapture(Listener listener = {})
      : m_listener(std::move(listener))
      , m_before(std::cout.rdbuf(this)) {}
  ~CoutCapture() override { std::cout.rdbuf(m_before); }

  std::vector<std::string> const& lines() const { return m_lines; }
  std::vector<std::string> take() {
    std::lock_guard const lock(m_mutex);
    return std::exchange(m_lines, {});
  }
  /// Number of lines that begin with `text`.
  int count(std::string const& text) const {
    int n = 0;
    for (auto const& line : m_lines) n += line.starts_with(text) ? 1 : 0;
    return n;
  }
  /// What follows `text` on the first line that begins with it; "(no line)" when none does.
  std::string after(std::string const& text) const {
    for (auto const& line : m_lines)
      if (line.starts_with(text)) return line.substr(text.size());
    return "(no line)";
  }
  std::string all() const {
    std::string text;
    for (auto const& line : m_lines) text += line + '\n';
    return text;
  }

private:
  int_type overflow(int_type c) override {
    char const text = traits_type::to_char_type(c);
    xsputn(&text, 1);
    return c;
  }
  std::streamsize xsputn(char const* text, std::streamsize n) override {
    std::lock_guard const lock(m_mutex);
    for (std::streamsize i = 0; i < n; ++i) {
      if (text[i] != '\n') {
        m_open += text[i];
        continue;
      }
      m_lines.push_back(std::exchange(m_open, {}));
      if (m_listener) m_listener(std::string(m_lines.back()));
    }
    return n;
  }

  Listener m_listener;
  std::recursive_mutex m_mutex;
  std::string m_open;
  std::vector<std::string> m_lines;
  std::streambuf* m_before;
};

} // namespace test
