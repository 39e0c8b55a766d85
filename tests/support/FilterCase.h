// A filter and names as a fuzzer's input: `filter/name/name/...`.
//
// The filter is read a second time here, straight from the description of the language, and every name is
// judged by that reading too. Beside the names given, names are made from the filter's own elements, so that
// patterns match something.
#pragma once

#include "GeometryVolume/utils/ChannelParser.h"
#include "GeometryVolume/utils/ChannelParserImpl.h"
#include "GeometryVolume/utils/ExpressionVisitor.h"
#include "support/FuzzCheck.h"

#include <algorithm>
#include <cstdint>
#include <sstream>
#include <string>
#include <string_view>
#include <vector>

namespace Support {

class FilterCase {
public:
  FilterCase(std::uint8_t const* data, std::size_t size) {
    std::string_view const all(reinterpret_cast<char const*>(data), size);
    std::size_t const slash = std::min(all.find('/'), all.size());
    m_text = std::string(all.substr(0, slash));
    read();
    for (std::size_t at = slash; at < all.size() && m_names.size() < 16;) {
      std::size_t const end = std::min(all.find('/', at + 1), all.size());
      m_names.emplace_back(all.substr(at + 1, end - at - 1));
      at = end;
    }
    for (std::size_t n = 0; n < m_elements.size() && n < 8; ++n) {
      for (char const* const star : {"", "*", "a.b", "\n"}) {
        std::string name;
        for (char const c : m_elements[n].pattern) c == '*' ? name += star : name += c;
        m_names.push_back(name);
      }
    }
    m_names.push_back("");
  }

  /// @return Whether the filter was accepted.
  bool run() const {
    VLN::Utils::ChannelParser parser;
    demand(!parser.accepts("a"), "an empty parser accepts");
    auto const status = parser.parses(m_text);
    demand(status.ok == m_error.empty() && status.message == m_error,
           "the answer is '" + status.message + "', not '" + m_error + "'");
    for (auto const& name : m_names) {
      if (auto const expected = accepted(name); expected != kTooLong)
        demand(parser.accepts(name) == (expected == kYes), "the name '" + name + "' is judged wrongly");
      else
        parser.accepts(name);
    }
    if (m_error != kNoOperand) checkTree();
    return status.ok;
  }

private:
  static constexpr char const* kNoOperand = "Expecting expression after unary !";
  static constexpr char const* kInvalid = "Expression Invalid";
  enum Answer { kNo, kYes, kTooLong };

  struct Element {
    std::size_t negations = 0;
    std::string pattern;
  };

  static bool isSpace(char c) { return std::string_view(" \t\n\v\f\r").find(c) != std::string_view::npos; }
  static bool isName(char c) {
    return std::string_view("abcdefghijklmnopqrstuvwxyzABCDEFGHIJKLMNOPQRSTUVWXYZ0123456789_*.:").find(c) !=
           std::string_view::npos;
  }

  /// The elements up to the first error, and the error.
  void read() {
    if (m_text.empty()) m_error = kInvalid;
    for (std::size_t at = 0; at < m_text.size();) {
      if (isSpace(m_text[at])) {
        ++at;
        continue;
      }
      Element element;
      for (; at < m_text.size() && (m_text[at] == '!' || m_text[at] == '^'); ++at) ++element.negations;
      bool valid = true;
      for (; at < m_text.size() && !isSpace(m_text[at]); ++at) {
        valid &= isName(m_text[at]);
        element.pattern += m_text[at];
      }
      if (!valid || element.pattern.empty()) {
        m_error = element.negations ? kNoOperand : kInvalid;
        if (m_error == kNoOperand) m_elements.clear(); // nothing is kept
        return;
      }
      m_elements.push_back(std::move(element));
    }
  }

  /// All prefixes of the name at once: which of them does the pattern so far match?
  static bool matches(std::string const& pattern, std::string const& name) {
    if (pattern.find_first_not_of('*') == std::string::npos) return true;
    std::vector<char> reached(name.size() + 1, 0);
    reached[0] = 1;
    for (char const c : pattern) {
      std::vector<char> next(name.size() + 1, 0);
      for (std::size_t n = 0; n <= name.size(); ++n) {
        if (c == '*')
          next[n] = reached[n] || (n && next[n - 1] && name[n - 1] != '\n' && name[n - 1] != '\r');
        else
          next[n] = n && reached[n - 1] && name[n - 1] == c;
      }
      reached = next;
    }
    return reached.back();
  }

  Answer accepted(std::string const& name) const {
    if (m_text.size() * name.size() > 20000) return kTooLong;
    bool any = false, none = false;
    for (Element const& e : m_elements) {
      // Undecided, accepted, rejected: a negation rejects what was accepted, and accepts all else.
      char verdict = matches(e.pattern, name) ? 'a' : 'u';
      for (std::size_t n = 0; n < e.negations; ++n) verdict = verdict == 'a' ? 'r' : 'a';
      any |= verdict == 'a';
      none |= verdict == 'r';
    }
    return any && !none ? kYes : kNo;
  }

  /// The tree's dump is that of the elements; written as a filter again, it parses to the same tree.
  void checkTree() const {
    using namespace VLN::Utils::Internal;
    auto const dumpOf = [](std::string const& text) {
      auto const tokens = tokenize(text);
      std::size_t cursor = 0;
      std::ostringstream os;
      parseList(tokens, cursor)->dump(os);
      return os.str();
    };
    std::string expected = "{ ", again;
    for (Element const& e : m_elements) {
      if (&e != m_elements.data()) expected += ", ", again += ' ';
      for (std::size_t n = 0; n < e.negations; ++n) expected += "{-", again += n % 2 ? '^' : '!';
      expected += "Literal: " + e.pattern, again += e.pattern;
      expected += std::string(e.negations, '}');
    }
    expected += '}';
    demand(dumpOf(m_text) == expected, "the tree is not that of the elements");
    if (!again.empty()) demand(dumpOf(again) == expected, "the elements do not parse to the same tree");
  }

  std::string m_text, m_error;
  std::vector<Element> m_elements;
  std::vector<std::string> m_names;
};

} // namespace Support
