// Keeps the scheduler's and the allocator's modules in memory until the process ends: pools free their blocks
// in static destructors, and worker threads may still run then.
#include "vljemalloc/vljemalloc.h"

#include <dlfcn.h>
#include <tbb/version.h>

namespace VLN {

namespace {

/// Holds the module that `address` lies in. The handle is never released.
void* pin(void const* address) {
  Dl_info info;
  if (!dladdr(address, &info) || !info.dli_fname) return nullptr;
  return dlopen(info.dli_fname, RTLD_NOW | RTLD_NOLOAD | RTLD_NODELETE);
}

[[maybe_unused]] void* const g_allocatorPin = pin(reinterpret_cast<void const*>(&vlje_free));
[[maybe_unused]] void* const g_schedulerPin = pin(reinterpret_cast<void const*>(&TBB_runtime_version));

} // namespace

} // namespace VLN
