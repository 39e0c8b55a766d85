# The command-line program vln.
vln_glob(sources tools/vln/*.cpp)
if(sources AND TARGET GeometryVolumeInterop)
  add_executable(vln ${sources})
  vln_target(vln)
  target_include_directories(vln PRIVATE "${PROJECT_SOURCE_DIR}/tools")
  target_link_libraries(vln PRIVATE
    GeometryVolumeInterop GeometryVolumeRender GeometryVolume CLI11::CLI11 PNG::PNG ZLIB::ZLIB fmt::fmt nlohmann_json::nlohmann_json)
  # When the program starts, 60,000 of OpenVDB's names are looked up in each library before it: it comes first.
  if(CMAKE_SYSTEM_NAME STREQUAL "Linux")
    target_link_options(vln PRIVATE LINKER:--push-state,--no-as-needed "${OpenVDB_LIBRARY}" LINKER:--pop-state)
  endif()
  file(RELATIVE_PATH lib_from_bin "/${CMAKE_INSTALL_BINDIR}" "/${CMAKE_INSTALL_LIBDIR}")
  set_target_properties(vln PROPERTIES INSTALL_RPATH "$ORIGIN/${lib_from_bin}")

  include(VlnView)

  # The program writes its manual page and completions itself; where it cannot run here they are left out.
  if(NOT CMAKE_CROSSCOMPILING)
    set(manual_dir "${PROJECT_BINARY_DIR}/manual")
    file(MAKE_DIRECTORY "${manual_dir}")
    add_custom_command(
      OUTPUT "${manual_dir}/vln.1" "${manual_dir}/vln" "${manual_dir}/_vln" "${manual_dir}/vln.fish"
      COMMAND vln manual > "${manual_dir}/vln.1"
      COMMAND vln completions bash > "${manual_dir}/vln"
      COMMAND vln completions zsh > "${manual_dir}/_vln"
      COMMAND vln completions fish > "${manual_dir}/vln.fish"
      DEPENDS vln
      COMMENT "Writing the manual page and completions of vln"
      VERBATIM)
    add_custom_target(vln_manual ALL DEPENDS "${manual_dir}/vln.1")
  endif()
else()
  message(STATUS "tools/vln or src/Interop has no source yet: no target vln")
endif()
