# Every switch of the build. docs/building.md explains them.

option(BUILD_SHARED_LIBS "Build the libraries as shared objects" ON)
option(VLN_BUILD_INTEROP "Build GeometryVolumeInterop (needs OpenVDB)" ${PROJECT_IS_TOP_LEVEL})
option(VLN_BUILD_TOOLS "Build the command-line program vln (needs GeometryVolumeInterop)" ${PROJECT_IS_TOP_LEVEL})
option(VLN_BUILD_TESTS "Build the tests" ${PROJECT_IS_TOP_LEVEL})
option(VLN_BUILD_EXAMPLES "Build the examples; with tests on, they are run as tests" ${PROJECT_IS_TOP_LEVEL})
option(VLN_BUILD_BENCH "Build the benchmarks" OFF)
option(VLN_BUILD_PYTHON "Build the Python module vln (needs pybind11, and VLN_ALLOCATOR=system)" OFF)
option(VLN_BUILD_FUZZ "Build the fuzzers (needs clang)" OFF)
option(VLN_WITH_VIEW "Build the page of vln view into the program (needs node and npm)" OFF)
option(VLN_WITH_CONVERTERS "Read and write .nvdb files, make level sets of meshes and meshes of level sets" ON)
option(VLN_WITH_HDF5 "Write .vtkhdf files (with libhdf5, where it is found)" ON)
option(VLN_WITH_CUDA "Build the device half of CopyableCudaDeviceBuffer (needs nvcc)" OFF)
option(VLN_WERROR "Treat warnings as errors" ${PROJECT_IS_TOP_LEVEL})
option(VLN_CCACHE "Compile through ccache when it is installed" ON)

set(VLN_ELEMENT_TYPES "all" CACHE STRING
  "Element types to instantiate: all, quick, or a ;-list of names such as float;double3")
set(VLN_ALLOCATOR "prefixed" CACHE STRING "Back end of vljemalloc: prefixed, linked or system")
set_property(CACHE VLN_ALLOCATOR PROPERTY STRINGS prefixed linked system)
set(VLN_SANITIZE "" CACHE STRING "Sanitizers: empty, address,undefined or thread")
set_property(CACHE VLN_SANITIZE PROPERTY STRINGS "" "address,undefined" "thread")

if(NOT VLN_ALLOCATOR MATCHES "^(prefixed|linked|system)$")
  message(FATAL_ERROR "VLN_ALLOCATOR is '${VLN_ALLOCATOR}'; it must be prefixed, linked or system")
endif()
if(VLN_SANITIZE AND NOT VLN_SANITIZE MATCHES "^(address|undefined|thread)(,(address|undefined))*$")
  message(FATAL_ERROR "VLN_SANITIZE is '${VLN_SANITIZE}'; use address, undefined, address,undefined or thread")
endif()
# A sanitizer can only see blocks that come from the allocator it intercepts.
if(VLN_SANITIZE MATCHES "address|thread" AND NOT VLN_ALLOCATOR STREQUAL "system")
  message(FATAL_ERROR "VLN_SANITIZE=${VLN_SANITIZE} needs VLN_ALLOCATOR=system")
endif()
if(VLN_BUILD_TOOLS AND NOT VLN_BUILD_INTEROP)
  message(FATAL_ERROR "VLN_BUILD_TOOLS needs VLN_BUILD_INTEROP: the program reads files through it")
endif()

if(NOT CMAKE_BUILD_TYPE AND NOT CMAKE_CONFIGURATION_TYPES)
  set(CMAKE_BUILD_TYPE Release CACHE STRING "Build type" FORCE)
endif()

# Where the real input files lie. In a linked git worktree they are beside the main checkout.
set(VLN_TEST_DATA_DIR "" CACHE PATH "Folder of real input files for the tests; empty: ../shared/data if present")

if(VLN_CCACHE AND NOT CMAKE_CXX_COMPILER_LAUNCHER)
  find_program(VLN_CCACHE_PROGRAM ccache)
  if(VLN_CCACHE_PROGRAM)
    # The base folder makes hits independent of where the checkout lies.
    set(CMAKE_CXX_COMPILER_LAUNCHER
      "${CMAKE_COMMAND};-E;env;CCACHE_BASEDIR=${PROJECT_SOURCE_DIR};${VLN_CCACHE_PROGRAM}")
  endif()
endif()

set(CMAKE_CXX_STANDARD 20)
set(CMAKE_CXX_STANDARD_REQUIRED ON)
set(CMAKE_CXX_EXTENSIONS OFF)
set(CMAKE_CXX_SCAN_FOR_MODULES OFF)
set(CMAKE_EXPORT_COMPILE_COMMANDS ON)
set(CMAKE_POSITION_INDEPENDENT_CODE ON)
set(CMAKE_CXX_VISIBILITY_PRESET hidden)
set(CMAKE_VISIBILITY_INLINES_HIDDEN ON)
if(PROJECT_IS_TOP_LEVEL)
  # -O2, not CMake's -O3: larger code for no measured gain here.
  set(CMAKE_CXX_FLAGS_RELEASE "-O2 -DNDEBUG")
  set(CMAKE_CXX_FLAGS_RELWITHDEBINFO "-O2 -g -DNDEBUG")
  set(CMAKE_RUNTIME_OUTPUT_DIRECTORY "${PROJECT_BINARY_DIR}/bin")
  set(CMAKE_LIBRARY_OUTPUT_DIRECTORY "${PROJECT_BINARY_DIR}/lib")
  set(CMAKE_ARCHIVE_OUTPUT_DIRECTORY "${PROJECT_BINARY_DIR}/lib")
endif()
