#pragma once

#include "Interop/PointVolume.h"

#include <nlohmann/json.hpp>

namespace Vln {

/// A volume of points in the shape that objects have in the report; the world box is that of the points.
nlohmann::ordered_json pointsJson(VLN::Interop::PointVolume const& volume);
/// The same as tables on standard output.
void printPoints(VLN::Interop::PointVolume const& volume, std::size_t n);

} // namespace Vln
