#pragma once

namespace VLN::Interop {

/// What the components of an element type are.
template <class T> struct ScalarOf { using type = T; };
template <class T>
requires requires { typename T::Scalar; }
struct ScalarOf<T> {
  using type = typename T::Scalar;
};

} // namespace VLN::Interop
