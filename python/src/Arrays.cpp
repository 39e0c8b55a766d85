#include "Arrays.h"

#include <cstring>
#include <limits>

namespace VLN::Python {

py::dtype dtypeOf(ElementInfo const& element) {
  return py::dtype(std::string(1, element.kind) + std::to_string(element.scalarBytes));
}

py::array newArray(ElementInfo const& element, std::vector<py::ssize_t> outer) {
  double bytes = element.bytes;
  for (auto const n : outer) bytes *= double(n);
  if (bytes > 1e15) {
    PyErr_SetString(PyExc_MemoryError, "the array would take more memory than there is");
    throw py::error_already_set();
  }
  for (int const n : element.shape) outer.push_back(n);
  return py::array(dtypeOf(element), outer);
}

py::array rowsOf(std::vector<int3> const& list) {
  py::array_t<int> rows({static_cast<py::ssize_t>(list.size()), py::ssize_t(3)});
  if (!list.empty()) std::memcpy(rows.mutable_data(), list.data(), list.size() * sizeof(int3));
  return rows;
}

int3 toInt3(std::array<std::int64_t, 3> const& values, char const* name) {
  for (auto const v : values)
    if (v < std::numeric_limits<int>::min() || v > std::numeric_limits<int>::max())
      throw py::value_error(std::string(name) + " holds " + std::to_string(v) +
                            ", which is beyond the reach of a volume");
  return {int(values[0]), int(values[1]), int(values[2])};
}

} // namespace VLN::Python
