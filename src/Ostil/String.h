#pragma once

#include <string>

namespace Ostil {

using String = std::string;

} // namespace Ostil
