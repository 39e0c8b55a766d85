#pragma once

#include "Ostil/Export.h"
#include "Ostil/String.h"

namespace Velorn::FileUtils {

/// Joins a directory and a name with one separator; an empty directory gives the name alone.
VLN_API Ostil::String filePath(Ostil::String const& directory, Ostil::String const& name);

/// The part behind the last separator.
VLN_API Ostil::String filename(Ostil::String const& path);

} // namespace Velorn::FileUtils
