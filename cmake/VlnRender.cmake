# GeometryVolumeRender: pictures of flat buffers. It stands on the reader's headers alone.
vln_glob(sources src/Render/*.cpp)
vln_glob(headers src/Render/*.h)
add_library(GeometryVolumeRender ${sources} ${headers})
add_library(GeometryVolume::GeometryVolumeRender ALIAS GeometryVolumeRender)
vln_target(GeometryVolumeRender)
target_compile_features(GeometryVolumeRender PUBLIC cxx_std_20)
target_include_directories(GeometryVolumeRender PUBLIC
  "$<BUILD_INTERFACE:${PROJECT_SOURCE_DIR}/src>"
  "$<INSTALL_INTERFACE:${CMAKE_INSTALL_INCLUDEDIR}/GeometryVolume>")
target_link_libraries(GeometryVolumeRender PRIVATE Threads::Threads)
set_target_properties(GeometryVolumeRender PROPERTIES
  VERSION ${PROJECT_VERSION}
  SOVERSION ${PROJECT_VERSION_MAJOR}.${PROJECT_VERSION_MINOR}
  INSTALL_RPATH "$ORIGIN")
