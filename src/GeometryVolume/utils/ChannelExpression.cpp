#include "GeometryVolume/utils/ChannelExpression.h"

#include "GeometryVolume/utils/ExpressionVisitor.h"

#include <ostream>

namespace VLN::Utils::Internal {

Expression::~Expression() = default;
ExpressionVisitor::~ExpressionVisitor() = default;

void ExpressionVisitor::visitExpression(Expression& expression) { expression.visit(*this); }
void ExpressionVisitor::visit(ListExpression& list) {
  for (auto const& expr : list.exprs()) visitExpression(*expr);
}
void ExpressionVisitor::visit(FuncOp& function) { visitExpression(function.expr()); }
void ExpressionVisitor::visit(NegateExpression& negation) { visitExpression(negation.expr()); }
void ExpressionVisitor::visit(BinaryOp& operation) {
  visitExpression(operation.left());
  visitExpression(operation.right());
}
void ExpressionVisitor::visit(Literal&) {}

void Literal::visit(ExpressionVisitor& visitor) { visitor.visit(*this); }
void BinaryOp::visit(ExpressionVisitor& visitor) { visitor.visit(*this); }
void NegateExpression::visit(ExpressionVisitor& visitor) { visitor.visit(*this); }
void FuncOp::visit(ExpressionVisitor& visitor) { visitor.visit(*this); }
void ListExpression::visit(ExpressionVisitor& visitor) { visitor.visit(*this); }

char BinaryOp::operatorToChar() const {
  switch (m_op) {
  case Op::kPlus:
    return '+';
  case Op::kMinus:
    return '-';
  case Op::kCaret:
    return '^';
  }
  return 'E';
}

// A filter may hold a million negations in a row: nothing here goes down such a chain by recursion.
NegateExpression::~NegateExpression() {
  while (auto* const inner = dynamic_cast<NegateExpression*>(m_expr.get())) {
    auto next = std::move(inner->m_expr);
    m_expr = std::move(next);
  }
}

void Literal::dump(std::ostream& os) const { os << "Literal: " << id(); }

void BinaryOp::dump(std::ostream& os) const {
  os << '{';
  m_left->dump(os);
  os << ' ' << operatorToChar() << ' ';
  m_right->dump(os);
  os << '}';
}

void FuncOp::dump(std::ostream& os) const {
  os << '{' << id() << ' ';
  m_expr->dump(os);
  os << '}';
}

void NegateExpression::dump(std::ostream& os) const {
  std::size_t levels = 1;
  os << "{-";
  Expression const* operand = m_expr.get();
  while (auto const* const inner = dynamic_cast<NegateExpression const*>(operand)) {
    os << "{-";
    ++levels;
    operand = inner->m_expr.get();
  }
  operand->dump(os);
  for (; levels; --levels) os << '}';
}

void ListExpression::dump(std::ostream& os) const {
  os << "{ ";
  char const* separator = "";
  for (auto const& expr : m_exprs) {
    os << separator;
    expr->dump(os);
    separator = ", ";
  }
  os << '}';
}

} // namespace VLN::Utils::Internal
