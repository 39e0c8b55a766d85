// .nvdb files whose voxels are codes of 4, 8, 16 or any number of bits, as NanoVDB itself writes them.
#include "Interop/ChannelValues.h"
#include "Interop/NvdbFile.h"
#include "Interop/VdbTypesImpl.h"
#include "support/TempFolder.h"
#include "support/TurnedRamp.h"

#include <gtest/gtest.h>

#include <nanovdb/util/IO.h>
#include <nanovdb/util/OpenToNanoVDB.h>

namespace VLN::Test {
namespace {

using namespace VLN::Interop;

template <class Code> class NvdbCodesTest : public testing::Test {};
using Codes = testing::Types<nanovdb::Fp4, nanovdb::Fp8, nanovdb::Fp16, nanovdb::FpN>;
TYPED_TEST_SUITE(NvdbCodesTest, Codes);

TYPED_TEST(NvdbCodesTest, RequirementCodesBecomeTheFloatsThatNanoVdbReads) {
  auto const ramp = turnedRamp();
  ramp->tree().setValueOn({1000, -2000, 3000}, 7.25f);
  auto const handle = nanovdb::openToNanoVDB<nanovdb::HostBuffer, openvdb::FloatTree, TypeParam>(*ramp);
  TempFolder const folder;
  nanovdb::io::writeGrid(folder / "a.nvdb", handle);
  auto const content = importNvdb(folder / "a.nvdb");
  ASSERT_EQ(content.volumes.size(), 1u);
  EXPECT_TRUE(content.skipped.empty());
  auto const& volume = content.volumes[0];
  EXPECT_EQ(volume.channels[0].type, "float");
  EXPECT_EQ(volume.channels[0].activeVoxels, static_cast<std::int64_t>(ramp->activeVoxelCount()));
  auto const values = ChannelValues::of(volume, "ramp");
  ASSERT_TRUE(values);
  auto const& tree = handle.template grid<TypeParam>()->tree();
  bool coded = false;
  for (auto it = ramp->cbeginValueOn(); it; ++it) {
    auto const at = it.getCoord();
    double found = 0;
    values->at({at.x(), at.y(), at.z()}, &found);
    ASSERT_EQ(found, double(tree.getValue({at.x(), at.y(), at.z()}))) << at;
    EXPECT_NEAR(found, *it, 4);
    coded = coded || found != double(*it);
  }
  EXPECT_TRUE(coded) << "the file holds no codes";
}

} // namespace
} // namespace VLN::Test
