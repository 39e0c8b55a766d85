// What must run on the threads of the scheduler themselves.
#pragma once

#include "GeometryVolume/core/Export.h"

namespace VLN::Internal {

/// Runs `body` once on about each worker thread. Workers that all wait for a lock which the calling thread
/// holds never come for it: after a while this thread does their part as well.
/// @return false where there are no workers.
/// @cost Wakes every worker.
VLN_API bool runOnEachWorker(void (*body)());

} // namespace VLN::Internal
