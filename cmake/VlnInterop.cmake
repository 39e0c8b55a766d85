# GeometryVolumeInterop: traffic with other formats. OpenVDB stays out of its interface, so a
# program that links the shared library needs OpenVDB at run time only.
vln_glob(sources src/Interop/*.cpp)
# OpenVDB's and NanoVDB's converters are large templates: two minutes of a processor.
if(VLN_WITH_CONVERTERS)
  list(FILTER sources EXCLUDE REGEX "/ConvertersLeftOut\\.cpp$")
else()
  list(FILTER sources EXCLUDE REGEX "/(NvdbFile|MeshVolume)\\.cpp$")
endif()
if(sources)
  vln_glob(headers src/Interop/*.h)
  add_library(GeometryVolumeInterop ${sources} ${headers})
  add_library(GeometryVolume::GeometryVolumeInterop ALIAS GeometryVolumeInterop)
  vln_target(GeometryVolumeInterop)
  target_link_libraries(GeometryVolumeInterop PUBLIC GeometryVolume)
  vln_uses_openvdb(GeometryVolumeInterop)
  target_link_libraries(GeometryVolumeInterop PRIVATE PNG::PNG)
  if(vln_hdf5)
    set_source_files_properties(src/Interop/Hdf5.cpp src/Interop/VtkHdfWrite.cpp PROPERTIES
      COMPILE_DEFINITIONS "VLN_HDF5=\"${vln_hdf5_name}\"" INCLUDE_DIRECTORIES "${VLN_HDF5_INCLUDE_DIR}")
    target_link_libraries(GeometryVolumeInterop PRIVATE ${CMAKE_DL_LIBS})
  endif()
  target_link_libraries(GeometryVolumeInterop PRIVATE NanoVDB::nanovdb ZLIB::ZLIB)
  # Large templates for each type, which move memory: they compile in half the time.
  set_source_files_properties(src/Interop/NvdbFile.cpp PROPERTIES COMPILE_OPTIONS -O1)
  if(VLN_BLOSC_LIBRARY)
    set_property(SOURCE src/Interop/NvdbFile.cpp APPEND PROPERTY COMPILE_DEFINITIONS VLN_BLOSC)
    target_link_libraries(GeometryVolumeInterop PRIVATE "${VLN_BLOSC_LIBRARY}")
  endif()
  set_target_properties(GeometryVolumeInterop PROPERTIES
    VERSION ${PROJECT_VERSION}
    SOVERSION ${PROJECT_VERSION_MAJOR}.${PROJECT_VERSION_MINOR}
    INSTALL_RPATH "$ORIGIN")
  # OpenVDB's templates have default visibility. Calls of the copies that are here need not be looked up at
  # each start, thousands of them by names of hundreds of letters.
  target_link_options(GeometryVolumeInterop PRIVATE -Wl,-Bsymbolic-functions
    "LINKER:--version-script=${PROJECT_SOURCE_DIR}/cmake/interop_exports.map")
  set_target_properties(GeometryVolumeInterop PROPERTIES LINK_DEPENDS "${PROJECT_SOURCE_DIR}/cmake/interop_exports.map")
else()
  message(STATUS "src/Interop has no source yet: no target GeometryVolumeInterop")
endif()
