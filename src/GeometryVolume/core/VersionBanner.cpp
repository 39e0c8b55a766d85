#include "GeometryVolume/core/Version.h"

#include <cstdlib>
#include <fcntl.h>
#include <iomanip>
#include <iostream>
#include <sstream>

namespace VLN {

namespace {

bool writeAtLoad() {
  char const* const value = std::getenv("KERRATE_DUMP_VERSION_INFO");
  bool const asked = value && std::atoi(value) != 0;
  bool const hasErrorStream = fcntl(2, F_GETFD) != -1;
  if (asked && hasErrorStream) {
    std::ostringstream line;
    line << std::setw(16) << "GeometryVolume"
         << ": " << versionBanner() << '\n';
    std::cerr << line.str();
  }
  return asked;
}

bool const g_asked = writeAtLoad();

} // namespace

Ostil::String versionBanner() {
  VersionInfo const& v = versionInfo();
  std::ostringstream banner;
  banner << "Velorn version " << v.majorNumber << '.' << v.minorNumber << ' ' << v.buildDate << ", build "
         << v.build << ", commit " << v.commit << ", branch " << v.branch;
  return banner.str();
}

bool versionBannerAsked() noexcept { return g_asked; }

} // namespace VLN
