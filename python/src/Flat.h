// Flat: a flat buffer as Python sees it.
#pragma once

#include "Names.h"

#include <pybind11/pybind11.h>

namespace VLN::Python {

void defineFlat(pybind11::module_& module);

} // namespace VLN::Python
