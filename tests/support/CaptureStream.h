// Catches what is written to a stream while it lives.
#pragma once

#include <iostream>
#include <sstream>
#include <string>

namespace Support {

class CaptureStream {
public:
  explicit CaptureStream(std::ostream& stream = std::cerr)
      : m_stream(stream)
      , m_old(stream.rdbuf(m_text.rdbuf())) {}
  ~CaptureStream() { m_stream.rdbuf(m_old); }
  CaptureStream(CaptureStream const&) = delete;
  CaptureStream& operator=(CaptureStream const&) = delete;
  std::string text() const { return m_text.str(); }

private:
  std::ostringstream m_text;
  std::ostream& m_stream;
  std::streambuf* m_old;
};

} // namespace Support
