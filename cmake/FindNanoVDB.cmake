# The NanoVDB headers: target NanoVDB::nanovdb.
find_path(NanoVDB_INCLUDE_DIR nanovdb/NanoVDB.h)
mark_as_advanced(NanoVDB_INCLUDE_DIR)

include(FindPackageHandleStandardArgs)
find_package_handle_standard_args(NanoVDB REQUIRED_VARS NanoVDB_INCLUDE_DIR)

if(NanoVDB_FOUND AND NOT TARGET NanoVDB::nanovdb)
  add_library(NanoVDB::nanovdb INTERFACE IMPORTED)
  target_include_directories(NanoVDB::nanovdb SYSTEM INTERFACE "${NanoVDB_INCLUDE_DIR}")
endif()
