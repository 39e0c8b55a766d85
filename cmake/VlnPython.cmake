# The Python module vln: an extension that holds the libraries whole, and the package's own sources beside it
# in <build>/python/vln, where the tests import it from.
if(NOT TARGET GeometryVolumeInterop)
  message(FATAL_ERROR "VLN_BUILD_PYTHON needs VLN_BUILD_INTEROP: the module reads files through it")
endif()
if(NOT VLN_ALLOCATOR STREQUAL "system")
  message(FATAL_ERROR "VLN_BUILD_PYTHON needs VLN_ALLOCATOR=system: the module is loaded by dlopen, and "
    "jemalloc's static thread-local storage does not fit there")
endif()

find_package(Python3 REQUIRED COMPONENTS Interpreter Development.Module)
set(PYTHON_EXECUTABLE "${Python3_EXECUTABLE}") # for pybind11's own search
find_package(pybind11 2.10 CONFIG REQUIRED)

vln_glob(sources python/src/*.cpp)
vln_glob(templates python/src/*.cpp.in)
vln_expand_templates(generated ${templates})

# What knows no Python is compiled apart, with the project's own warnings.
add_library(vln_python_engine STATIC python/src/ChannelOps.cpp ${generated})
vln_target(vln_python_engine)
target_include_directories(vln_python_engine PRIVATE "${PROJECT_SOURCE_DIR}/python/src")
target_link_libraries(vln_python_engine PRIVATE GeometryVolume)

list(FILTER sources EXCLUDE REGEX "/ChannelOps\\.cpp$")
pybind11_add_module(_vln MODULE NO_EXTRAS ${sources})
vln_target(_vln)
target_include_directories(_vln PRIVATE "${PROJECT_SOURCE_DIR}/python/src")
target_link_libraries(_vln PRIVATE vln_python_engine GeometryVolumeInterop GeometryVolumeRender GeometryVolume)
set(python_package_dir "${PROJECT_BINARY_DIR}/python/vln")
set_target_properties(_vln PROPERTIES LIBRARY_OUTPUT_DIRECTORY "${python_package_dir}")
if(NOT VLN_SANITIZE)
  # The libraries' own exports stay inside, so that another copy of them in the process is not met.
  target_link_options(_vln PRIVATE -Wl,--exclude-libs,ALL)
endif()

vln_glob(package python/vln/*.py python/vln/*.pyi python/vln/py.typed)
add_custom_target(vln_python_package ALL
  COMMAND "${CMAKE_COMMAND}" -E make_directory "${python_package_dir}"
  COMMAND "${CMAKE_COMMAND}" -E copy_if_different ${package} "${python_package_dir}"
  DEPENDS ${package} COMMENT "" VERBATIM)
add_dependencies(_vln vln_python_package)

# For the Debian package: where the distribution's interpreter looks, and what tells it of the version. A wheel is
# made without these rules, see python/packaging.
set(python_dir lib/python3/dist-packages)
set(info_dir "${PROJECT_BINARY_DIR}/python/info")
install(TARGETS _vln LIBRARY DESTINATION "${python_dir}/vln" COMPONENT python)
install(FILES ${package} DESTINATION "${python_dir}/vln" COMPONENT python)
install(CODE "
  file(REMOVE_RECURSE \"${info_dir}\")
  file(MAKE_DIRECTORY \"${info_dir}\")
  execute_process(COMMAND \"${Python3_EXECUTABLE}\" -B -c
    \"import sys, build_wheel; build_wheel.prepare_metadata_for_build_wheel(sys.argv[1])\" \"${info_dir}\"
    WORKING_DIRECTORY \"${PROJECT_SOURCE_DIR}/python/packaging\" COMMAND_ERROR_IS_FATAL ANY)" COMPONENT python)
install(DIRECTORY "${info_dir}/" DESTINATION "${python_dir}" COMPONENT python)

enable_testing()
include(VlnTestData)
set(test_environment "PYTHONPATH=${PROJECT_BINARY_DIR}/python" PYTHONDONTWRITEBYTECODE=1
  "VLN_TEST_DATA_DIR=${vln_test_data}")
if(VLN_SANITIZE MATCHES "address")
  # The interpreter is not instrumented: the sanitizer must come first, and sees what Python never frees as leaks.
  execute_process(COMMAND "${CMAKE_CXX_COMPILER}" -print-file-name=libasan.so
    OUTPUT_VARIABLE libasan OUTPUT_STRIP_TRAILING_WHITESPACE)
  execute_process(COMMAND "${CMAKE_CXX_COMPILER}" -print-file-name=libstdc++.so
    OUTPUT_VARIABLE libstdcxx OUTPUT_STRIP_TRAILING_WHITESPACE)
  # The C++ library too: what throws is looked up when the sanitizer is loaded.
  list(APPEND test_environment "LD_PRELOAD=${libasan} ${libstdcxx}" PYTHONMALLOC=malloc
    "ASAN_OPTIONS=detect_leaks=0:allocator_may_return_null=1" "UBSAN_OPTIONS=print_stacktrace=1:halt_on_error=1")
endif()
vln_glob(tests python/tests/test_*.py)
foreach(test IN LISTS tests)
  get_filename_component(name "${test}" NAME_WE)
  add_test(NAME python.${name}
    COMMAND "${Python3_EXECUTABLE}" -m pytest -q -p no:cacheprovider "${test}")
  set_tests_properties(python.${name} PROPERTIES LABELS python TIMEOUT 900 ENVIRONMENT "${test_environment}")
endforeach()
