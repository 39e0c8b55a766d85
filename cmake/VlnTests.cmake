# One GoogleTest binary test_<room> for each folder of tests/ that holds a source, with the label
# <room>. tests/support is for shared helper headers, tests/package is a project of its own.
include(GoogleTest)

include(VlnTestData)
if(NOT vln_test_data)
  message(STATUS "No ../shared/data: tests on real input files will be skipped")
endif()

# What helpers of more than one room are too long for a header.
vln_glob(sources tests/support/*.cpp)
add_library(test_support STATIC ${sources})
vln_target(test_support)
target_include_directories(test_support PRIVATE "${PROJECT_SOURCE_DIR}/tests")
target_link_libraries(test_support PRIVATE GeometryVolume GTest::gtest)

vln_folders(rooms tests)
list(REMOVE_ITEM rooms support package)
foreach(room IN LISTS rooms)
  vln_glob(sources tests/${room}/*.cpp)
  vln_glob(templates tests/${room}/*.cpp.in)
  vln_expand_templates(generated ${templates})
  if(room STREQUAL "interop" AND NOT TARGET GeometryVolumeInterop)
    continue()
  endif()
  if(room STREQUAL "vln" AND NOT TARGET vln)
    continue()
  endif()

  set(target test_${room})
  add_executable(${target} ${sources} ${generated})
  vln_target(${target})
  target_include_directories(${target} PRIVATE
    "${PROJECT_SOURCE_DIR}/tests" "${PROJECT_SOURCE_DIR}/tests/${room}")
  target_compile_definitions(${target} PRIVATE
    "VLN_TEST_DATA_DIR=\"${vln_test_data}\"" "VLN_TEST_ALLOCATOR=\"${VLN_ALLOCATOR}\"")
  target_link_libraries(${target} PRIVATE
    test_support GeometryVolume TBB::tbb Threads::Threads ${CMAKE_DL_LIBS}
    GTest::gmock GTest::gtest GTest::gtest_main)
  if(room STREQUAL "render")
    target_link_libraries(${target} PRIVATE GeometryVolumeRender)
    if(vln_cuda) # compiled, not run
      add_library(test_render_kernels OBJECT tests/render/Kernels.cu)
      target_link_libraries(test_render_kernels PRIVATE GeometryVolumeReader)
      target_compile_options(test_render_kernels PRIVATE --fmad=false)
      set_target_properties(test_render_kernels PROPERTIES CUDA_STANDARD 17 CUDA_STANDARD_REQUIRED ON)
    endif()
  endif()
  if(room STREQUAL "faults" AND TARGET GeometryVolumeInterop)
    target_link_libraries(${target} PRIVATE GeometryVolumeInterop)
    target_compile_definitions(${target} PRIVATE VLN_TEST_INTEROP)
  endif()
  if(room STREQUAL "interop" OR room STREQUAL "vln")
    target_link_libraries(${target} PRIVATE GeometryVolumeInterop)
    vln_uses_openvdb(${target})
    if(PNG_FOUND)
      target_link_libraries(${target} PRIVATE PNG::PNG)
    endif()
    if(nlohmann_json_FOUND)
      target_link_libraries(${target} PRIVATE nlohmann_json::nlohmann_json)
    endif()
  endif()
  if(room STREQUAL "vln")
    if(VLN_SANITIZE) # the program, which does the work, is compiled by itself: half of the time for these
      target_compile_options(${target} PRIVATE -O0)
    endif()
    # Loaded before the program, lets system calls fail on purpose.
    add_library(vln_failing_calls MODULE tests/support/FailingCalls.cpp)
    target_link_libraries(vln_failing_calls PRIVATE ${CMAKE_DL_LIBS})
    target_compile_features(vln_failing_calls PRIVATE cxx_std_20)
    target_compile_definitions(${target} PRIVATE "VLN_PROGRAM=\"$<TARGET_FILE:vln>\""
      "VLN_FAILING_CALLS=\"$<TARGET_FILE:vln_failing_calls>\"")
    add_dependencies(${target} vln vln_failing_calls)
    if(VLN_WITH_VIEW) # of one source: the others are not compiled again where it is turned on
      set_source_files_properties("${PROJECT_SOURCE_DIR}/tests/vln/ViewProgramTest.cpp" PROPERTIES COMPILE_DEFINITIONS
        "VLN_WITH_VIEW;VLN_NODE=\"${VLN_NODE}\";VLN_VIEW_TEST=\"${PROJECT_SOURCE_DIR}/web/test/view.mjs\";VLN_VIEW_MODULES=\"${view_folder}\"")
    endif()
  endif()
  # PRE_TEST: the list is asked for when ctest starts, not at the end of every link.
  gtest_discover_tests(${target}
    TEST_PREFIX "${room}."
    DISCOVERY_MODE PRE_TEST
    DISCOVERY_TIMEOUT 60
    PROPERTIES LABELS "${room}" TIMEOUT 600)
endforeach()
