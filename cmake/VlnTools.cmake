# The command-line program vln.
vln_glob(sources tools/vln/*.cpp)
if(sources AND TARGET GeometryVolumeInterop)
  add_executable(vln ${sources})
  vln_target(vln)
  target_include_directories(vln PRIVATE "${PROJECT_SOURCE_DIR}/tools")
  target_link_libraries(vln PRIVATE
    GeometryVolumeInterop GeometryVolume CLI11::CLI11 PNG::PNG fmt::fmt nlohmann_json::nlohmann_json)
  file(RELATIVE_PATH lib_from_bin "/${CMAKE_INSTALL_BINDIR}" "/${CMAKE_INSTALL_LIBDIR}")
  set_target_properties(vln PROPERTIES INSTALL_RPATH "$ORIGIN/${lib_from_bin}")
else()
  message(STATUS "tools/vln or src/Interop has no source yet: no target vln")
endif()
