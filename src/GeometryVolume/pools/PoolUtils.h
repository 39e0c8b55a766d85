// PoolUtils: how much memory there is, for pools that keep some of it free.
#pragma once

#include "GeometryVolume/core/Export.h"
#include "Ostil/String.h"

#include <cstdint>

namespace VLN::TileTree3D::PoolUtils {

/// @units Bytes.
struct MemoryStats {
  std::uint64_t totalPhysical;
  std::uint64_t availablePhysical;
};

/// Physical memory of the machine, narrowed by the control group when one is set.
/// @error false when there are no figures; `out` is then as it was. That is so when the system does not
/// tell, and when the control group's directory is missing or holds a file that is no number.
/// @threads Any thread.
VLN_API bool getMemoryStats(MemoryStats& out);

/// @units 1 MB = 1,048,576 bytes.
VLN_API float toMB(std::uint64_t bytes);

/// Whether VELORN_ENABLE_VLN_POOL_UTILS_LOGGING held a number other than 0 at load. Then each reading of the
/// statistics writes one line to standard output.
VLN_API bool loggingEnabled();

/// Directory of the control group whose limit and usage narrow getMemoryStats(); empty for none. At load it
/// is the value of VELORN_CGROUP_PATH.
///
///   version 2:  memory.max ("max": no limit), memory.current
///   version 1:  memory.limit_in_bytes, memory.usage_in_bytes
///
/// A directory without a limit narrows nothing.
VLN_API Ostil::String cgroupPath();
/// Names another control group.
/// @threads Any thread; a call of getMemoryStats() that runs already keeps the old one.
VLN_API void setCgroupPath(Ostil::String const& path);

/// Narrows getMemoryStats() to what this process may have resident; 0, as at load, for no such limit. The
/// pools then let go of idle memory before the process goes beyond it.
/// @units Bytes.
/// @threads Any thread.
VLN_API void setProcessLimit(std::uint64_t bytes);
VLN_API std::uint64_t processLimit();
/// Memory of this process that is resident now; 0 when the system does not tell.
/// @units Bytes.
VLN_API std::uint64_t residentMemory();

} // namespace VLN::TileTree3D::PoolUtils
