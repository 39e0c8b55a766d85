#pragma once

#include "GeometryVolume/core/Export.h"
#include "Ostil/String.h"

namespace VLN {

/// What this build of the library was made from. The texts live as long as the library.
struct VersionInfo {
  int majorNumber;
  int minorNumber;
  int patchNumber;
  const char* buildDate; ///< year-month-day in UTC, taken from SOURCE_DATE_EPOCH when that is set
  const char* build;     ///< number of commits that lead here, "0" outside a checkout
  const char* commit;    ///< short commit identifier, "unknown" outside a checkout
  const char* branch;    ///< branch name, "unknown" outside a checkout
};

/// The version of the library that is loaded, not of the headers that were compiled against.
VLN_API const VersionInfo& versionInfo() noexcept;

/// The version in one line: product, numbers, build date, build, commit and branch. It is written to standard
/// error at load when the environment variable KERRATE_DUMP_VERSION_INFO holds a number other than 0.
VLN_API Ostil::String versionBanner();
/// Whether that variable asked for the line.
VLN_API bool versionBannerAsked() noexcept;

} // namespace VLN
