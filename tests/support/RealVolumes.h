// The volumes of the shared test data, as parameters of tests.
#pragma once

#include <gtest/gtest.h>

#include <string>

namespace VLN::Test {

inline auto realVolumes() {
  return testing::Values("bunny_ls_128.vdb", "bunny_ls_512_half.vdb", "mantaflow_smoke_0010.vdb", "smoke.vdb",
                         "sphere.vdb", "sphereCd.vdb", "sphere_points.vdb", "spot_ls_128.vdb");
}
inline std::string volumeName(testing::TestParamInfo<char const*> const& info) {
  std::string const name = info.param;
  return name.substr(0, name.find('.'));
}

} // namespace VLN::Test
