#include "GeometryVolume/core/LoggerHooks.h"

namespace VLN::Internal {

constinit VLN::Internal::Atomic<LoggerHooks const*> g_loggerHooks{nullptr};

} // namespace VLN::Internal
