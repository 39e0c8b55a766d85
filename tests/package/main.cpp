#include "GeometryVolume/core/Version.h"
#include "GeometryVolume/tiletree/Container.h"

#include <cstdio>

int main() {
  using namespace VLN::TileTree3D;

  const VLN::VersionInfo& info = VLN::versionInfo();
  std::printf("linked with GeometryVolume %d.%d.%d, commit %s\n", info.majorNumber, info.minorNumber,
              info.patchNumber, info.commit);

  Container<PowerOfTwoTraits> tree;
  tree.tileAccessor().addTile(0, 0, 0, 3);
  return tree.tileCount(3) == 1 ? 0 : 1;
}
