// A fuzzer's bytes as a sequence of small decisions. When they are used up, every decision is the first one.
#pragma once

#include <cstddef>
#include <cstdint>

namespace Support {

class Choices {
public:
  Choices(std::uint8_t const* data, std::size_t size)
      : m_next(data)
      , m_end(data + size) {}

  bool ended() const { return m_next == m_end; }
  int byte() { return ended() ? 0 : *m_next++; }
  /// 0 .. n - 1.
  int below(int n) { return (n > 256 ? byte() * 256 + byte() : byte()) % n; }
  bool coin() { return byte() % 2 != 0; }
  /// -n .. n.
  int within(int n) { return below(2 * n + 1) - n; }

private:
  std::uint8_t const* m_next;
  std::uint8_t const* m_end;
};

} // namespace Support
