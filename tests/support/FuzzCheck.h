// What a fuzzer's case demands. A broken demand is thrown: nothing catches it under the fuzzer, which keeps
// the input and ends; a test reports it.
#pragma once

#include <stdexcept>
#include <string>

namespace Support {

struct FuzzFailure : std::logic_error {
  using std::logic_error::logic_error;
};

inline void demand(bool holds, std::string const& what) {
  if (!holds) throw FuzzFailure(what);
}

/// What is shown of a foreign file: some text, without anything that moves a terminal's cursor.
inline void demandOneLine(std::string const& text) {
  demand(!text.empty() && text.size() < 1000, "the message is empty or long");
  for (char const c : text)
    demand(static_cast<unsigned char>(c) >= ' ' && c != '\x7F', "the message is not one line of text");
}

} // namespace Support
