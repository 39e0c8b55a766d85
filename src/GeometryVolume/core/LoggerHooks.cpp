#include "GeometryVolume/core/LoggerHooks.h"

namespace VLN::Internal {

constinit std::atomic<LoggerHooks const*> g_loggerHooks{nullptr};

} // namespace VLN::Internal
