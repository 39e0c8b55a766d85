#include "GeometryVolume/utils/ChannelParser.h"
#include "GeometryVolume/utils/ChannelParserImpl.h"
#include "GeometryVolume/utils/ExpressionVisitor.h"

#include <gtest/gtest.h>

#include <chrono>
#include <sstream>
#include <string>
#include <vector>

namespace {

using VLN::Utils::ChannelParser;
using VLN::Utils::Symbol;
using VLN::Utils::Token;
using namespace VLN::Utils::Internal;

ChannelParser parsed(std::string const& text) {
  ChannelParser parser;
  auto const status = parser.parses(text);
  EXPECT_TRUE(status) << '"' << text << "\": " << status.message;
  EXPECT_EQ(status.message, "");
  return parser;
}

std::string refusal(std::string const& text) {
  ChannelParser parser;
  auto const status = parser.parses(text);
  EXPECT_FALSE(status.ok) << text;
  EXPECT_EQ(static_cast<bool>(status), status.ok);
  return status.message;
}

std::string dumped(std::string const& text) {
  auto const tokens = tokenize(text);
  std::size_t cursor = 0;
  std::ostringstream os;
  parseList(tokens, cursor)->dump(os);
  return os.str();
}

std::unique_ptr<Expression> literal(std::string const& text) {
  return std::make_unique<Literal>(Token{Symbol::kLiteral, text});
}

TEST(ChannelParser, BoundaryWithoutAParseNothingPasses) {
  EXPECT_FALSE(ChannelParser().accepts("a"));
  EXPECT_FALSE(ChannelParser().accepts(""));
}

TEST(ChannelParser, NegativeEmptyTextIsInvalid) { EXPECT_EQ(refusal(""), "Expression Invalid"); }

TEST(ChannelParser, BoundaryWhiteSpaceAloneIsAnEmptyListThatPassesNothing) {
  for (std::string const text : {" ", "\t\n \v\f\r"}) {
    auto const parser = parsed(text);
    EXPECT_FALSE(parser.accepts(""));
    EXPECT_FALSE(parser.accepts("a"));
  }
}

TEST(ChannelParser, RequirementANamePassesWhenAnElementAcceptsIt) {
  for (std::string const text : {"a b", " a  b ", "a\tb\n"}) {
    auto const parser = parsed(text);
    EXPECT_TRUE(parser.accepts("a"));
    EXPECT_TRUE(parser.accepts("b"));
    EXPECT_FALSE(parser.accepts("c"));
    EXPECT_FALSE(parser.accepts("A"));
    EXPECT_FALSE(parser.accepts("aa"));
    EXPECT_FALSE(parser.accepts(""));
  }
}

TEST(ChannelParser, RequirementRejectionStaysWhateverTheOrder) {
  for (std::string const text : {"a* !ab", "!ab a*"}) {
    auto const parser = parsed(text);
    EXPECT_TRUE(parser.accepts("ac"));
    EXPECT_FALSE(parser.accepts("ab"));
    EXPECT_TRUE(parser.accepts("b")) << "the negation accepts what it does not match";
  }
}

TEST(ChannelParser, RequirementNegationHasTwoSpellings) {
  for (std::string const text : {"!a", "^a"}) {
    auto const parser = parsed(text);
    EXPECT_TRUE(parser.accepts("b"));
    EXPECT_FALSE(parser.accepts("a"));
  }
  EXPECT_TRUE(parsed("!tmp*").accepts("density"));
  EXPECT_FALSE(parsed("!tmp*").accepts("tmp1"));
}

TEST(ChannelParser, RequirementNegationsNest) {
  for (std::string const text : {"!!a", "!^a", "^!a"}) {
    auto const parser = parsed(text);
    EXPECT_TRUE(parser.accepts("a"));
    EXPECT_FALSE(parser.accepts("b"));
  }
}

TEST(ChannelParser, NegativeNegationWithoutOperand) {
  for (std::string const text : {"!", "! a", "a !", "!!", "^ ", "!$"})
    EXPECT_EQ(refusal(text), "Expecting expression after unary !") << text;
}

TEST(ChannelParser, NegativeForeignCharacters) {
  for (std::string const text : {"a$", "$", "a b$ c", "a!b", "a^", "a,b", "a-b", "\xC3\xA4", "a\xFF"})
    EXPECT_EQ(refusal(text), "Expression Invalid") << text;
  EXPECT_EQ(refusal(std::string("a b\0", 4)), "Expression Invalid");
  EXPECT_EQ(refusal(std::string("\0", 1)), "Expression Invalid");
}

TEST(ChannelParser, BoundaryWhatStandsBeforeAForeignCharacterIsKept) {
  ChannelParser parser = parsed("z");
  EXPECT_FALSE(parser.parses("a $ b"));
  EXPECT_TRUE(parser.accepts("a"));
  EXPECT_FALSE(parser.accepts("b"));
  EXPECT_FALSE(parser.accepts("z"));
  // A list that cannot be finished leaves the former one.
  EXPECT_FALSE(parser.parses("b !"));
  EXPECT_TRUE(parser.accepts("a"));
  EXPECT_FALSE(parser.accepts("b"));
}

TEST(ChannelParser, RequirementDotsAndColonsArePlain) {
  EXPECT_TRUE(parsed("a.b").accepts("a.b"));
  EXPECT_FALSE(parsed("a.b").accepts("axb"));
  EXPECT_TRUE(parsed("a.*").accepts("a.x"));
  EXPECT_FALSE(parsed("a.*").accepts("axx"));
  EXPECT_TRUE(parsed("ns:vel_*").accepts("ns:vel_x"));
  EXPECT_FALSE(parsed("ns:vel_*").accepts("ns.vel_x"));
}

TEST(ChannelParser, RequirementStarsAloneAcceptEveryName) {
  for (std::string const text : {"*", "***"})
    for (std::string const name : {"", "a", "two words", "line\nend"})
      EXPECT_TRUE(parsed(text).accepts(name)) << text << ' ' << name;
  EXPECT_FALSE(parsed("!*").accepts("a"));
}

TEST(ChannelParser, RequirementMatchesWholeNames) {
  auto const parser = parsed("den*");
  EXPECT_TRUE(parser.accepts("den"));
  EXPECT_TRUE(parser.accepts("density"));
  EXPECT_FALSE(parser.accepts("xden"));
  EXPECT_FALSE(parser.accepts("de"));
}

TEST(ChannelTokens, RequirementKindsAndTexts) {
  auto const tokens = tokenize("ab  a*:_.9 !^");
  std::vector<Symbol> const kinds{Symbol::kLiteral,    Symbol::kWhitespace, Symbol::kWildLiteral,
                                  Symbol::kWhitespace, Symbol::kNegation,   Symbol::kNegation,
                                  Symbol::kInvalid,    Symbol::kEnd};
  ASSERT_EQ(tokens.size(), kinds.size())
      << "a text that ends in a negation has an invalid token before its end";
  for (std::size_t n = 0; n < kinds.size(); ++n) EXPECT_EQ(tokens[n].symbol, kinds[n]) << n;
  EXPECT_EQ(tokens[0].text, "ab");
  EXPECT_EQ(tokens[2].text, "a*:_.9");
  EXPECT_EQ(tokens[6].text, "Invalid Character: \xFF");

  auto const empty = tokenize("");
  ASSERT_EQ(empty.size(), 2u);
  EXPECT_EQ(empty[0].symbol, Symbol::kInvalid);
  EXPECT_EQ(empty[1].symbol, Symbol::kEnd);
  EXPECT_EQ(tokenize("a").size(), 2u);
  EXPECT_EQ(tokenize("a ").size(), 3u);
  EXPECT_EQ(tokenize("$")[0].text, "Invalid Character: $");
  EXPECT_EQ(tokenize("a$")[0].text, "Invalid character: $") << "another capital inside a literal";
  EXPECT_EQ(tokenize("a!b")[0].symbol, Symbol::kInvalid);
  EXPECT_EQ(tokenize(std::string("\0", 1))[0].text, "");
}

TEST(ChannelTokens, NegativeACaretOperatorIsUnexpected) {
  // The tokens of filters have none; lists made by hand may.
  std::vector<Token> const tokens{{Symbol::kLiteral, "a"}, {Symbol::kCaret, "^"}, {Symbol::kEnd, ""}};
  std::size_t cursor = 0;
  try {
    parseList(tokens, cursor);
    ADD_FAILURE();
  } catch (ParseError const& error) {
    EXPECT_STREQ(error.what(), "Unexpected tokens in property filter expression.");
  }
}

TEST(ChannelExpression, RequirementDumps) {
  EXPECT_EQ(dumped(" "), "{ }");
  EXPECT_EQ(dumped("a"), "{ Literal: a}");
  EXPECT_EQ(dumped("a b* !c"), "{ Literal: a, Literal: b*, {-Literal: c}}");
  EXPECT_EQ(dumped("!!a"), "{ {-{-Literal: a}}}");
  std::ostringstream os;
  BinaryOp(literal("a"), literal("b"), BinaryOp::Op::kMinus).dump(os);
  os << ' ';
  FuncOp(literal("a"), Token{Symbol::kLiteral, "abs"}).dump(os);
  EXPECT_EQ(os.str(), "{Literal: a - Literal: b} {abs Literal: a}");
}

TEST(ChannelExpression, RequirementAccessors) {
  Literal const plain(Token{Symbol::kLiteral, "a"}), wild(Token{Symbol::kWildLiteral, "*"});
  EXPECT_EQ(plain.id(), "a");
  EXPECT_FALSE(plain.isWildLiteral());
  EXPECT_TRUE(wild.isWildLiteral());
  char const signs[] = {'+', '-', '^', 'E', 'E'};
  for (int value = 0; value < 5; ++value) {
    auto const op = BinaryOp::opFromSymbol(static_cast<Symbol>(value + 3));
    EXPECT_EQ(static_cast<int>(op), value);
    BinaryOp const operation(literal("l"), literal("r"), op);
    EXPECT_EQ(operation.op(), op);
    EXPECT_EQ(operation.operatorToChar(), signs[value]);
    EXPECT_EQ(dynamic_cast<Literal&>(operation.left()).id(), "l");
    EXPECT_EQ(dynamic_cast<Literal&>(operation.right()).id(), "r");
  }
  EXPECT_EQ(static_cast<int>(BinaryOp::opFromSymbol(Symbol::kInvalid)), -3);
}

TEST(ChannelExpression, RequirementVisitorsWalkInOrder) {
  struct Recorder final : ExpressionVisitor {
    using ExpressionVisitor::visit;
    void visit(Literal& l) override { text += l.id(); }
    std::string text;
  } recorder;
  std::vector<std::unique_ptr<Expression>> exprs;
  exprs.push_back(std::make_unique<BinaryOp>(literal("a"), literal("b"), BinaryOp::Op::kPlus));
  exprs.push_back(std::make_unique<NegateExpression>(literal("c")));
  exprs.push_back(std::make_unique<FuncOp>(literal("d"), Token{}));
  exprs.push_back(literal("e"));
  ListExpression list(std::move(exprs));
  recorder.visitExpression(list);
  EXPECT_EQ(recorder.text, "abcde");
}

std::string evaluationError(std::unique_ptr<Expression> expr) {
  std::vector<std::unique_ptr<Expression>> exprs;
  exprs.push_back(std::move(expr));
  ListExpression list(std::move(exprs));
  try {
    filterAccepts(list, "a");
  } catch (std::runtime_error const& error) { return error.what(); }
  return "";
}

TEST(ChannelExpression, NegativeOperatorsAreNotForFilters) {
  EXPECT_EQ(evaluationError(std::make_unique<BinaryOp>(literal("a"), literal("b"), BinaryOp::Op::kPlus)),
            "Binary operations are not supported in property filter expressions");
  EXPECT_EQ(evaluationError(std::make_unique<FuncOp>(literal("a"), Token{})),
            "Function operations are not supported in property filter expressions");
}

// Each of these overflowed the stack or ran for hours if names were matched by regular expressions, or chains
// of negations by recursion.
TEST(ChannelParser, RegressionLongTextsNeedNeitherStackNorPatience) {
  auto const start = std::chrono::steady_clock::now();
  std::size_t const many = 1000000;
  std::string const longName(many, 'a');
  EXPECT_TRUE(parsed("a*").accepts(longName));
  EXPECT_TRUE(parsed(longName).accepts(longName));
  EXPECT_TRUE(parsed(longName + "*").accepts(longName));
  EXPECT_FALSE(parsed("a*b").accepts(longName));
  EXPECT_FALSE(parsed("*" + std::string(many / 2, 'a') + "b*").accepts(longName));
  std::string manyStars;
  for (std::size_t n = 0; n < many / 2; ++n) manyStars += "*a";
  EXPECT_TRUE(parsed(manyStars).accepts(longName));
  EXPECT_FALSE(parsed(manyStars + "b").accepts(longName));

  auto const negated = parsed(std::string(many, '!') + "a");
  EXPECT_TRUE(negated.accepts("a"));
  EXPECT_FALSE(negated.accepts("b"));
  EXPECT_FALSE(parsed(std::string(many + 1, '^') + "a").accepts("a"));
  EXPECT_EQ(dumped(std::string(many, '!') + "a").size(), 3 * many + 13);
  EXPECT_EQ(refusal(std::string(many, '!')), "Expecting expression after unary !");
  std::string manyNames;
  for (std::size_t n = 0; n < many / 2; ++n) manyNames += "x ";
  EXPECT_FALSE(parsed(manyNames).accepts("a"));
  EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(60));
}

} // namespace
