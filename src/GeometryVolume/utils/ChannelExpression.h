// The tree that a property filter expression is compiled to. Filters give lists of literals and negations;
// the other classes serve trees made by hand, which filters refuse to evaluate.
#pragma once

#include "GeometryVolume/core/Export.h"
#include "GeometryVolume/utils/ChannelToken.h"

#include <iosfwd>
#include <memory>
#include <utility>
#include <vector>

namespace VLN::Utils::Internal {

class ExpressionVisitor;

class VLN_API Expression {
public:
  Expression() = default;
  Expression(Expression const&) = delete;
  Expression& operator=(Expression const&) = delete;
  virtual ~Expression();
  /// Calls the visitor's operation for this class.
  virtual void visit(ExpressionVisitor& visitor) = 0;
  /// One line of text, without a line end.
  virtual void dump(std::ostream& os) const = 0;
};

class VLN_API Literal final : public Expression {
public:
  explicit Literal(Token token)
      : m_token(std::move(token)) {}
  std::string const& id() const { return m_token.text; }
  bool isWildLiteral() const { return m_token.symbol == Symbol::kWildLiteral; }
  void visit(ExpressionVisitor& visitor) override;
  void dump(std::ostream& os) const override;

private:
  Token m_token;
};

class VLN_API BinaryOp final : public Expression {
public:
  enum class Op { kPlus = 0, kMinus = 1, kCaret = 2 };

  BinaryOp(std::unique_ptr<Expression> left, std::unique_ptr<Expression> right, Op op)
      : m_left(std::move(left))
      , m_right(std::move(right))
      , m_op(op) {}
  static Op opFromSymbol(Symbol symbol) {
    return static_cast<Op>(static_cast<int>(symbol) - static_cast<int>(Symbol::kPlus));
  }
  Expression& left() const { return *m_left; }
  Expression& right() const { return *m_right; }
  Op op() const { return m_op; }
  /// @edges 'E' for a value that is no operator.
  char operatorToChar() const;
  void visit(ExpressionVisitor& visitor) override;
  void dump(std::ostream& os) const override;

private:
  std::unique_ptr<Expression> m_left;
  std::unique_ptr<Expression> m_right;
  Op m_op;
};

class VLN_API NegateExpression final : public Expression {
public:
  explicit NegateExpression(std::unique_ptr<Expression> expr)
      : m_expr(std::move(expr)) {}
  ~NegateExpression() override;
  Expression& expr() const { return *m_expr; }
  void visit(ExpressionVisitor& visitor) override;
  void dump(std::ostream& os) const override;

private:
  std::unique_ptr<Expression> m_expr;
};

class VLN_API FuncOp final : public Expression {
public:
  FuncOp(std::unique_ptr<Expression> expr, Token token)
      : m_expr(std::move(expr))
      , m_token(std::move(token)) {}
  Expression& expr() const { return *m_expr; }
  std::string const& id() const { return m_token.text; }
  void visit(ExpressionVisitor& visitor) override;
  void dump(std::ostream& os) const override;

private:
  std::unique_ptr<Expression> m_expr;
  Token m_token;
};

class VLN_API ListExpression final : public Expression {
public:
  explicit ListExpression(std::vector<std::unique_ptr<Expression>> exprs)
      : m_exprs(std::move(exprs)) {}
  std::vector<std::unique_ptr<Expression>> const& exprs() const { return m_exprs; }
  void visit(ExpressionVisitor& visitor) override;
  void dump(std::ostream& os) const override;

private:
  std::vector<std::unique_ptr<Expression>> m_exprs;
};

} // namespace VLN::Utils::Internal
