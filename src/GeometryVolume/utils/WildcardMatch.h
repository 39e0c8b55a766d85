// Names against patterns in which `*` stands for any run of characters.
#pragma once

#include "GeometryVolume/core/Export.h"

#include <string_view>

namespace VLN::Utils {

/// Whether the whole name matches. All characters but `*` stand for themselves.
/// @edges As `.*` of a regular expression, `*` stands for no line end: a name with one matches nothing but a
/// pattern of `*` alone, which matches every name.
/// @cost Linear in both lengths, whatever the pattern; no recursion.
VLN_API bool wildcardMatch(std::string_view pattern, std::string_view name);

} // namespace VLN::Utils
