# The OpenVDB library with what its headers need: target OpenVDB::openvdb.
#
# The module that comes with OpenVDB looks for everything the library itself was ever built
# with; a program that only calls it needs far less.
find_path(OpenVDB_INCLUDE_DIR openvdb/openvdb.h)
find_library(OpenVDB_LIBRARY openvdb)
mark_as_advanced(OpenVDB_INCLUDE_DIR OpenVDB_LIBRARY)

if(OpenVDB_INCLUDE_DIR AND EXISTS "${OpenVDB_INCLUDE_DIR}/openvdb/version.h")
  set(OpenVDB_VERSION)
  foreach(part MAJOR MINOR PATCH)
    file(STRINGS "${OpenVDB_INCLUDE_DIR}/openvdb/version.h" line
      REGEX "^#define OPENVDB_LIBRARY_${part}_VERSION_NUMBER +[0-9]+" LIMIT_COUNT 1)
    string(REGEX REPLACE ".* +" "" number "${line}")
    list(APPEND OpenVDB_VERSION ${number})
  endforeach()
  list(JOIN OpenVDB_VERSION "." OpenVDB_VERSION)
endif()

find_package(TBB CONFIG QUIET)
# Not by Imath's own package: that one complains when its Python half is not installed.
find_path(Imath_INCLUDE_DIR Imath/half.h)
find_library(Imath_LIBRARY NAMES Imath Imath-3_1 Imath-3_2)
mark_as_advanced(Imath_INCLUDE_DIR Imath_LIBRARY)
find_package(Boost QUIET COMPONENTS iostreams)
find_package(Threads QUIET)

include(FindPackageHandleStandardArgs)
find_package_handle_standard_args(OpenVDB
  REQUIRED_VARS OpenVDB_LIBRARY OpenVDB_INCLUDE_DIR TBB_FOUND Imath_LIBRARY Imath_INCLUDE_DIR Boost_FOUND
  VERSION_VAR OpenVDB_VERSION)

if(OpenVDB_FOUND AND NOT TARGET OpenVDB::openvdb)
  add_library(OpenVDB::openvdb UNKNOWN IMPORTED)
  set_target_properties(OpenVDB::openvdb PROPERTIES IMPORTED_LOCATION "${OpenVDB_LIBRARY}")
  target_include_directories(OpenVDB::openvdb SYSTEM INTERFACE
    "${OpenVDB_INCLUDE_DIR}" "${Imath_INCLUDE_DIR}")
  target_link_libraries(OpenVDB::openvdb INTERFACE
    TBB::tbb "${Imath_LIBRARY}" Boost::iostreams Threads::Threads)
endif()
