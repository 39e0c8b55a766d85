// A path for a log file.
#pragma once

#include "GeometryVolume/core/Export.h"
#include "Ostil/String.h"

namespace VLN::Utils {

/// Path of a file that does not exist yet: directory/vlndumpXXXXXX_name, where XXXXXX are random letters and
/// digits. The directory is the value of TEMP, tmp or temp, whichever is set first (an empty value names
/// the current one), else the system's. No
/// file is made.
/// @edges Of a name with folders the last part is taken; an empty name leaves vlndumpXXXXXX.
/// @threads Any thread that does not change the environment meanwhile.
VLN_API Ostil::String createLogPath(Ostil::String const& name);

} // namespace VLN::Utils
