#include "GeometryVolume/utils/ChannelParser.h"

#include "GeometryVolume/utils/ChannelParserImpl.h"
#include "GeometryVolume/utils/ExpressionVisitor.h"
#include "GeometryVolume/utils/WildcardMatch.h"

#include <utility>

namespace VLN::Utils {

namespace Internal {

namespace {

bool startsElement(Symbol symbol) {
  return symbol == Symbol::kLiteral || symbol == Symbol::kWildLiteral || symbol == Symbol::kCaret ||
         symbol == Symbol::kNegation;
}

/// Null when no operand stands there. The negations in front are counted, not descended into.
std::unique_ptr<Expression> parseUnary(std::vector<Token> const& tokens, std::size_t& cursor) {
  std::size_t negations = 0;
  for (; tokens[cursor].symbol == Symbol::kNegation; ++cursor) ++negations;
  Symbol const symbol = tokens[cursor].symbol;
  if (symbol != Symbol::kLiteral && symbol != Symbol::kWildLiteral) {
    if (negations) throw ParseError("Expecting expression after unary !");
    return nullptr;
  }
  std::unique_ptr<Expression> expr = std::make_unique<Literal>(tokens[cursor++]);
  for (; negations; --negations) expr = std::make_unique<NegateExpression>(std::move(expr));
  return expr;
}

/// What an element says about a name.
enum class Verdict { kAccepted = 0, kUndecided = 1, kRejected = 2 };

class FilterVisitor final : public ExpressionVisitor {
public:
  static Verdict judge(Expression& expression, Ostil::String const& name) {
    FilterVisitor visitor(name);
    visitor.visitExpression(expression);
    return visitor.m_result;
  }

  using ExpressionVisitor::visit;
  void visit(BinaryOp&) override {
    throw std::runtime_error("Binary operations are not supported in property filter expressions");
  }
  void visit(FuncOp&) override {
    throw std::runtime_error("Function operations are not supported in property filter expressions");
  }
  void visit(Literal& literal) override {
    bool const matches =
        literal.isWildLiteral() ? wildcardMatch(literal.id(), *m_name) : literal.id() == *m_name;
    settle(matches ? Verdict::kAccepted : Verdict::kUndecided);
  }
  void visit(NegateExpression& negation) override {
    // Long chains of negations are walked, not descended into.
    std::size_t negations = 1;
    Expression* operand = &negation.expr();
    while (auto* const inner = dynamic_cast<NegateExpression*>(operand)) {
      operand = &inner->expr();
      ++negations;
    }
    Verdict verdict = judge(*operand, *m_name);
    for (; negations; --negations)
      verdict = verdict == Verdict::kAccepted ? Verdict::kRejected : Verdict::kAccepted;
    settle(verdict);
  }
  void visit(ListExpression& list) override {
    for (auto const& expr : list.exprs()) {
      Verdict const verdict = judge(*expr, *m_name);
      if (verdict != Verdict::kUndecided) settle(verdict);
    }
  }

private:
  explicit FilterVisitor(Ostil::String const& name)
      : m_name(&name) {}

  /// Rejection stays.
  void settle(Verdict verdict) {
    if (m_result != Verdict::kRejected) m_result = verdict;
  }

  Ostil::String const* m_name;
  Verdict m_result = Verdict::kUndecided;
};

} // namespace

std::unique_ptr<ListExpression> parseList(std::vector<Token> const& tokens, std::size_t& cursor) {
  std::vector<std::unique_ptr<Expression>> exprs;
  for (;;) {
    Symbol const symbol = tokens[cursor].symbol;
    if (symbol == Symbol::kWhitespace) {
      ++cursor;
    } else if (startsElement(symbol)) {
      auto expr = parseUnary(tokens, cursor);
      if (!expr) throw ParseError("Unexpected tokens in property filter expression.");
      exprs.push_back(std::move(expr));
    } else {
      break;
    }
  }
  if (tokens[cursor].symbol == Symbol::kEnd) ++cursor;
  return std::make_unique<ListExpression>(std::move(exprs));
}

bool filterAccepts(Expression& root, Ostil::String const& name) {
  return FilterVisitor::judge(root, name) == Verdict::kAccepted;
}

} // namespace Internal

ChannelParser::ChannelParser() = default;
ChannelParser::ChannelParser(ChannelParser&&) noexcept = default;
ChannelParser& ChannelParser::operator=(ChannelParser&&) noexcept = default;
ChannelParser::~ChannelParser() = default;

ChannelParser::Status ChannelParser::parses(Ostil::String const& text) {
  try {
    auto const tokens = Internal::tokenize(text);
    std::size_t cursor = 0;
    m_root = Internal::parseList(tokens, cursor);
    if (cursor != tokens.size()) throw Internal::ParseError("Expression Invalid");
  } catch (Internal::ParseError const& error) { return {error.what(), false}; }
  return {"", true};
}

bool ChannelParser::accepts(Ostil::String const& name) const {
  return m_root && Internal::filterAccepts(*m_root, name);
}

} // namespace VLN::Utils
