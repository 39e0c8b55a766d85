// Real volumes as flat buffers and back, by the slow reader: every tile and every sample.
#include "Interop/VdbImport.h"
#include "Reader/NanoVTTValidate.h"
#include "support/FlatChecks.h"
#include "support/RealVolumes.h"
#include "support/TempFolder.h"

#include <gtest/gtest.h>

#include <filesystem>

namespace VLN::Test {
namespace {

using Support::FlatOptions;
using Support::FlatVolume;

class FlatReal : public ::testing::TestWithParam<char const*> {};

template <class BuildT = void>
void check(FlatVolume const& volume, FlatOptions const& options, std::string const& label) {
  auto const handle = Support::flatten<BuildT>(*volume.object, options);
  if (handle.empty()) return Support::expectFlat<BuildT>(volume, options, handle, label);
  auto const answer = nanovtt::validate(handle.data(), handle.size());
  ASSERT_TRUE(answer.ok()) << label << ": " << answer.message << " at " << answer.position;
  Support::FlatModel const model(handle.data(), handle.size());
  // Fog or distances in coarse tiles may raise the roots; what depth the conversion chose is then taken over.
  Support::expectFlat<BuildT>(volume, options, handle, label, model.rootDepth);
}

TEST_P(FlatReal, RequirementEveryTileAndSampleIsFoundAgain) {
  std::string const path = dataFile(std::string("vdb/") + GetParam());
  if (path.empty()) GTEST_SKIP() << "no test data";
  bool const large = std::filesystem::file_size(path) > 3000000;
  for (auto const& found : Interop::importVdb(path).volumes) {
    FlatVolume const volume(found.object);
    FlatOptions options;
    EXPECT_FALSE(Support::flatten<>(*volume.object, options).empty());
    check(volume, options, GetParam());
    options.coalesce = true, options.haloFraction = 0.5f;
    check(volume, options, std::string(GetParam()) + " coalesced");
    if (large) continue;
    options.coalesce = false, options.morton = true, options.haloFraction = 1;
    check(volume, options, std::string(GetParam()) + " Morton");
    options.tolerance = 0.01f;
    check<nanovdb::Fp4>(volume, options, std::string(GetParam()) + " Fp4");
    check<nanovdb::Fp8>(volume, options, std::string(GetParam()) + " Fp8");
    check<nanovdb::Fp16>(volume, options, std::string(GetParam()) + " Fp16");
    check<nanovdb::FpN>(volume, options, std::string(GetParam()) + " FpN");
  }
}

INSTANTIATE_TEST_SUITE_P(Files, FlatReal, realVolumes(), volumeName);

} // namespace
} // namespace VLN::Test
