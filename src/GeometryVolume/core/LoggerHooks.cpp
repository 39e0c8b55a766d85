#include "GeometryVolume/core/LoggerHooks.h"

namespace VLN::Internal {

constinit Ostil::Atomic<LoggerHooks const*> g_loggerHooks{nullptr};

} // namespace VLN::Internal
