#include "GeometryVolume/utils/ChannelParserImpl.h"

namespace VLN::Utils::Internal {

namespace {

// Not <cctype>: the language is the same in every locale.
bool isSpace(char c) { return c == ' ' || (c >= '\t' && c <= '\r'); }
bool isLiteral(char c) {
  return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') || c == '_' || c == '*' ||
         c == '.' || c == ':';
}

/// Reads as a stream does: the end is known only after a character has been looked for behind it.
class Reader {
public:
  explicit Reader(Ostil::String const& text)
      : m_text(text) {}

  Token next() {
    if (m_ended) return {Symbol::kEnd, ""};
    char const c = atEnd() ? '\xFF' : m_text[m_position];
    if (isLiteral(c)) return literal();
    ++m_position;
    if (c == '\0') return {Symbol::kInvalid, ""};
    if (c == '!' || c == '^') return {Symbol::kNegation, std::string(1, c)};
    if (isSpace(c)) {
      while (!atEnd() && isSpace(m_text[m_position])) ++m_position;
      return {Symbol::kWhitespace, ""};
    }
    return {Symbol::kInvalid, std::string("Invalid Character: ") + c};
  }

private:
  bool atEnd() {
    m_ended = m_position >= m_text.size();
    return m_ended;
  }

  Token literal() {
    std::size_t const start = m_position;
    bool wild = false;
    for (; !atEnd() && !isSpace(m_text[m_position]); ++m_position) {
      char const c = m_text[m_position];
      if (!isLiteral(c)) {
        ++m_position;
        return {Symbol::kInvalid, std::string("Invalid character: ") + c};
      }
      wild |= c == '*';
    }
    return {wild ? Symbol::kWildLiteral : Symbol::kLiteral, m_text.substr(start, m_position - start)};
  }

  Ostil::String const& m_text;
  std::size_t m_position = 0;
  bool m_ended = false;
};

} // namespace

std::vector<Token> tokenize(Ostil::String const& text) {
  Reader reader(text);
  std::vector<Token> tokens;
  do tokens.push_back(reader.next());
  while (tokens.back().symbol != Symbol::kEnd);
  return tokens;
}

} // namespace VLN::Utils::Internal
