#include "Ostil/Job.h"

#include <atomic>

namespace Ostil {

namespace {
std::atomic<bool> g_cancelled{false};
}

bool isJobCancelled() { return g_cancelled.load(std::memory_order_relaxed); }
void setJobCancelled(bool cancelled) { g_cancelled.store(cancelled, std::memory_order_relaxed); }

} // namespace Ostil
