# A program fuzz_<name> for each fuzz/<name>.cpp, with clang's libFuzzer. The library must be compiled with
# -fsanitize=fuzzer-no-link: the preset "fuzz" does so, and scripts/fuzz.sh uses it.
find_package(GTest REQUIRED)

if(TARGET GeometryVolumeInterop)
  target_compile_options(GeometryVolumeInterop PRIVATE
    "-fsanitize-ignorelist=${PROJECT_SOURCE_DIR}/fuzz/foreign_headers.txt")
endif()

# vln_fuzzer(NAME LIBRARY...)
function(vln_fuzzer name)
  set(target fuzz_${name})
  add_executable(${target} fuzz/${name}.cpp)
  vln_target(${target})
  target_include_directories(${target} PRIVATE "${PROJECT_SOURCE_DIR}/src" "${PROJECT_SOURCE_DIR}/tests")
  target_compile_definitions(${target} PRIVATE "VLN_TEST_DATA_DIR=\"\"")
  target_link_options(${target} PRIVATE -fsanitize=fuzzer)
  target_link_libraries(${target} PRIVATE ${ARGN})
endfunction()

vln_fuzzer(flat_buffer)
vln_fuzzer(filter GeometryVolume)
# The models of the tests are told in GoogleTest's assertions.
vln_fuzzer(operations GeometryVolume GTest::gtest)
if(TARGET GeometryVolumeInterop)
  vln_fuzzer(ply_file GeometryVolumeInterop)
  vln_fuzzer(vdb_file GeometryVolumeInterop)
  vln_fuzzer(vdb_walk GeometryVolumeInterop)
  vln_uses_openvdb(fuzz_vdb_walk)
  vln_fuzzer(npz_file GeometryVolumeInterop)
  vln_fuzzer(vti_file GeometryVolumeInterop)
endif()
