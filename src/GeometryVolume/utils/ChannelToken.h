// The tokens of property filter expressions.
#pragma once

#include <string>

namespace VLN::Utils {

/// The values are those of the language; the gaps are kinds that filters do without.
enum class Symbol {
  kInvalid = 0,
  kLiteral = 1,
  /// A literal with at least one `*`.
  kWildLiteral = 2,
  kPlus = 3,
  kMinus = 4,
  kCaret = 5,
  kNegation = 6,
  kWhitespace = 9,
  kEnd = 10,
};

struct Token {
  Symbol symbol = Symbol::kInvalid;
  std::string text;
};

} // namespace VLN::Utils
