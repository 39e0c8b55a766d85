#pragma once

#include "Ostil/Export.h"

namespace VLN {

/// Text of every exception that ends a cancelled job.
VLN_API extern char const* const exceptionMessage;

} // namespace VLN
