// The job that the host runs the calling code for.
#pragma once

#include "Ostil/Export.h"

namespace Ostil {

/// Whether the host has cancelled the current job. Long parallel loops poll it.
/// @threads Any thread, lock-free.
VLN_API bool isJobCancelled();

/// Sets the answer of isJobCancelled(): for hosts that have no job system of their own, and for tests.
VLN_API void setJobCancelled(bool cancelled);

} // namespace Ostil
