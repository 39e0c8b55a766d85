// Texts between Python and C++, names of grids and of files above all. Files hold any bytes as names, and so
// may file systems: bytes that are no UTF-8 become lone surrogates and back, as os.fsdecode() has it.
//
// Comes before all other headers of pybind11, which use its own conversion.
#pragma once

#include <string>

#include <pybind11/cast.h>

namespace pybind11::detail {

template <> struct type_caster<std::string, void> {
  PYBIND11_TYPE_CASTER(std::string, const_name("str"));

  bool load(handle from, bool) {
    if (!from || !PyUnicode_Check(from.ptr())) return false;
    auto const bytes =
        reinterpret_steal<object>(PyUnicode_AsEncodedString(from.ptr(), "utf-8", "surrogateescape"));
    if (!bytes) {
      PyErr_Clear();
      return false;
    }
    value.assign(PyBytes_AS_STRING(bytes.ptr()), static_cast<std::size_t>(PyBytes_GET_SIZE(bytes.ptr())));
    return true;
  }
  static handle cast(std::string const& text, return_value_policy, handle) {
    PyObject* const made =
        PyUnicode_DecodeUTF8(text.data(), static_cast<ssize_t>(text.size()), "surrogateescape");
    if (!made) throw error_already_set();
    return made;
  }
};

} // namespace pybind11::detail
