// Replays the fuzzer's .vdb files without the fuzzer: small files of every type of grid, and mutations of
// them. They are not compressed, so that a changed byte is a changed number.
#include "Interop/VdbPoints.h"
#include "Interop/VdbTypesImpl.h"
#include "support/FuzzReplay.h"
#include "support/VdbCase.h"

namespace {

using Support::VdbCase;

VLN::Test::TempFolder const& folder() {
  static VLN::Test::TempFolder const made;
  return made;
}

std::string fileOf(openvdb::GridPtrVec const& grids,
                   std::uint32_t compression = openvdb::io::COMPRESS_ACTIVE_MASK) {
  std::string const path = folder() / "seed.vdb";
  openvdb::io::File file(path);
  file.setCompression(compression);
  openvdb::MetaMap metadata;
  metadata.insertMeta("made by", openvdb::StringMetadata("a test"));
  file.write(grids, metadata);
  file.close();
  return VLN::Test::readAll(path);
}

/// Some voxels, and a tile of the file.
template <class GridT>
typename GridT::Ptr small(typename GridT::ValueType const& v, std::string const& name) {
  auto grid = GridT::create();
  for (int n = 0; n < 9; ++n) grid->tree().setValueOn(openvdb::Coord(n - 4, n % 3, 0), v);
  grid->tree().addTile(1, openvdb::Coord(64, 0, 0), v, true);
  grid->setName(name);
  return grid;
}

std::vector<std::string> seeds() {
  openvdb::initialize();
  using namespace openvdb;
  std::vector<std::string> list;
  auto const fog = small<FloatGrid>(0.5f, "density");
  fog->setGridClass(GRID_FOG_VOLUME);
  list.push_back(fileOf({fog}));
  auto const half = small<FloatGrid>(0.25f, "half");
  half->setSaveFloatAsHalf(true);
  half->setTransform(math::Transform::createLinearTransform(0.1));
  list.push_back(fileOf({half}));
  auto const surface = FloatGrid::create(3.0f);
  surface->tree().addTile(1, Coord(8, 0, 0), -3.0f, false);
  for (int n = 0; n < 20; ++n) surface->tree().setValueOn(Coord(n % 5, n / 5, 0), float(n) / 8 - 1);
  surface->setGridClass(GRID_LEVEL_SET);
  surface->insertMeta("author", StringMetadata("a test"));
  list.push_back(fileOf({surface}));
  list.push_back(fileOf({small<DoubleGrid>(1.5, "double")}));
  list.push_back(fileOf({small<Int32Grid>(7, "int")}));
  list.push_back(fileOf({small<Int64Grid>(-7, "long")}));
  list.push_back(fileOf({small<BoolGrid>(true, "bool"), small<MaskGrid>(true, "mask")}));
  list.push_back(fileOf({small<Vec3SGrid>(Vec3s(1, 2, 3), "v"), small<Vec3DGrid>(Vec3d(1, 2, 3), "v")}));
  list.push_back(fileOf({small<Vec3IGrid>(Vec3i(1, 2, 3), "vi")}));
  auto const moved = small<FloatGrid>(1.0f, "moved");
  moved->setTransform(math::Transform::createFrustumTransform(BBoxd(Vec3d(0), Vec3d(9)), 0.5, 2.0));
  list.push_back(fileOf({moved}));
  auto const rotated = small<FloatGrid>(1.0f, "rotated");
  rotated->transform().postScale(Vec3d(1, 2, 3));
  rotated->transform().postRotate(0.3, math::Y_AXIS);
  rotated->transform().postTranslate(Vec3d(5, 6, 7));
  // Two grids that share a tree, and one that is empty.
  list.push_back(fileOf({rotated, FloatGrid::create(1.0f), GridBase::Ptr(rotated->copyGrid())}));
  list.push_back(fileOf({small<FloatGrid>(2.0f, "zip")}, io::COMPRESS_ZIP | io::COMPRESS_ACTIVE_MASK));
  list.push_back(fileOf({}));
  VLN::Interop::PointSet points;
  auto id = VLN::Interop::makeAttribute<int>("id");
  for (int n = 0; n < 12; ++n) {
    points.positions.push_back({float(n), 0.5f, float(-n)});
    id.append(n);
  }
  points.attributes.push_back(id);
  VLN::Interop::writeVdbPoints(folder() / "points.vdb", points);
  list.push_back(VLN::Test::readAll(folder() / "points.vdb"));
  return list;
}

TEST(VdbFuzz, RequirementSeedsAreReadWrittenAndReadAgain) { Support::replay<VdbCase>("vdb", seeds()); }

TEST(VdbFuzz, RequirementMutatedFilesAreReadOrRefusedWithOneLine) {
  auto const list = seeds();
  int accepted = 0;
  for (unsigned n = 0; n < 100; ++n) {
    std::string bytes = list[n % list.size()];
    VdbCase::mutate(reinterpret_cast<std::uint8_t*>(bytes.data()), bytes.size(), n);
    try {
      accepted += Support::runCase<VdbCase>(bytes);
    } catch (Support::FuzzFailure const& failure) { FAIL() << failure.what() << "\nseed and number " << n; }
  }
  EXPECT_GT(accepted, 5);
}

} // namespace
