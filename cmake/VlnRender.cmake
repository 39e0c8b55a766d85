# GeometryVolume::Reader: the reader of flat buffers, headers that depend on nothing. Who uses it links
# nothing.
add_library(GeometryVolumeReader INTERFACE)
add_library(GeometryVolume::Reader ALIAS GeometryVolumeReader)
set_target_properties(GeometryVolumeReader PROPERTIES EXPORT_NAME Reader)
target_compile_features(GeometryVolumeReader INTERFACE cxx_std_17)
target_include_directories(GeometryVolumeReader INTERFACE
  "$<BUILD_INTERFACE:${PROJECT_SOURCE_DIR}/src>"
  "$<INSTALL_INTERFACE:${CMAKE_INSTALL_INCLUDEDIR}/GeometryVolume>")

# GeometryVolumeRender: pictures of flat buffers. It stands on the reader's headers alone.
vln_glob(sources src/Render/*.cpp)
vln_glob(headers src/Render/*.h)
add_library(GeometryVolumeRender ${sources} ${headers})
add_library(GeometryVolume::GeometryVolumeRender ALIAS GeometryVolumeRender)
vln_target(GeometryVolumeRender)
target_compile_features(GeometryVolumeRender PUBLIC cxx_std_20)
target_link_libraries(GeometryVolumeRender PUBLIC GeometryVolumeReader PRIVATE Threads::Threads)
set_target_properties(GeometryVolumeRender PROPERTIES
  VERSION ${PROJECT_VERSION}
  SOVERSION ${PROJECT_VERSION_MAJOR}.${PROJECT_VERSION_MINOR}
  INSTALL_RPATH "$ORIGIN")
# The loops over rays: half again as fast as at -O2, where loops over three axes stay loops.
set_source_files_properties(src/Render/Renderer.cpp PROPERTIES COMPILE_OPTIONS "$<$<CONFIG:Release,RelWithDebInfo>:-O3>")
