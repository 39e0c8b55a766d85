// Between numpy arrays and plain memory.
#pragma once

#include "ChannelOps.h"
#include "Names.h"

#include <pybind11/numpy.h>
#include <pybind11/pybind11.h>
#include <pybind11/stl.h>

namespace VLN::Python {

namespace py = pybind11;

py::dtype dtypeOf(ElementInfo const& element);

/// A new array of shape `outer` + the element's own, C order, unwritten.
/// @error MemoryError where the size is out of reach.
py::array newArray(ElementInfo const& element, std::vector<py::ssize_t> outer);

/// Positions as an (N, 3) array, contiguous, of the asked type.
template <class Scalar> using Rows = py::array_t<Scalar, py::array::c_style>;

/// @error ValueError unless the array is of shape (N, 3).
template <class Scalar> py::ssize_t rowCount(Rows<Scalar> const& rows, char const* name) {
  if (rows.ndim() != 2 || rows.shape(1) != 3)
    throw py::value_error(std::string(name) + " must be of shape (N, 3)");
  return rows.shape(0);
}

/// A list of int3 as an (N, 3) array of int32. @error MemoryError.
py::array rowsOf(std::vector<int3> const& list);

int3 toInt3(std::array<std::int64_t, 3> const& values, char const* name);

} // namespace VLN::Python
