#include "GeometryVolume/core/Version.h"

#include <cstdio>

int main() {
  const VLN::VersionInfo& info = VLN::versionInfo();
  std::printf("linked with GeometryVolume %d.%d.%d, commit %s\n", info.majorNumber, info.minorNumber,
              info.patchNumber, info.commit);
  return 0;
}
