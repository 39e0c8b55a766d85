// ExpressionVisitor: what is to be done at each kind of expression.
#pragma once

#include "GeometryVolume/core/Export.h"

namespace VLN::Utils::Internal {

class Expression;
class ListExpression;
class FuncOp;
class NegateExpression;
class BinaryOp;
class Literal;

/// By default walks the tree: elements in order, the left operand before the right.
class VLN_API ExpressionVisitor {
public:
  virtual ~ExpressionVisitor();
  virtual void visitExpression(Expression& expression);
  virtual void visit(ListExpression& list);
  virtual void visit(FuncOp& function);
  virtual void visit(NegateExpression& negation);
  virtual void visit(BinaryOp& operation);
  virtual void visit(Literal& literal);
};

} // namespace VLN::Utils::Internal
