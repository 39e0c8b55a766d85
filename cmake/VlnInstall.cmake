# Install rules and the CMake package. Headers go by glob: every *.h of a room except the
# implementation headers *Impl.h. scripts/check_install compares the outcome with
# cmake/install_manifest.txt. Every rule names the component, which is the package that it goes into, see
# VlnPackages.cmake.
include(CMakePackageConfigHelpers)

set(include_dir "${CMAKE_INSTALL_INCLUDEDIR}/GeometryVolume")
set(package_dir "${CMAKE_INSTALL_LIBDIR}/cmake/GeometryVolume")

install(TARGETS GeometryVolume GeometryVolumeRender GeometryVolumeReader EXPORT GeometryVolumeTargets
  RUNTIME DESTINATION "${CMAKE_INSTALL_BINDIR}" COMPONENT library
  LIBRARY DESTINATION "${CMAKE_INSTALL_LIBDIR}" COMPONENT library NAMELINK_COMPONENT development
  ARCHIVE DESTINATION "${CMAKE_INSTALL_LIBDIR}" COMPONENT development)
install(EXPORT GeometryVolumeTargets NAMESPACE GeometryVolume:: DESTINATION "${package_dir}" COMPONENT development)

set(rooms Ostil Velorn vljemalloc Reader Render GeometryVolume)
if(TARGET GeometryVolumeInterop)
  list(APPEND rooms Interop)
  install(TARGETS GeometryVolumeInterop EXPORT GeometryVolumeInteropTargets
    RUNTIME DESTINATION "${CMAKE_INSTALL_BINDIR}" COMPONENT interop
    LIBRARY DESTINATION "${CMAKE_INSTALL_LIBDIR}" COMPONENT interop NAMELINK_COMPONENT development
    ARCHIVE DESTINATION "${CMAKE_INSTALL_LIBDIR}" COMPONENT development)
  install(EXPORT GeometryVolumeInteropTargets NAMESPACE GeometryVolume:: DESTINATION "${package_dir}"
    COMPONENT development)
  install(FILES "${PROJECT_SOURCE_DIR}/cmake/FindOpenVDB.cmake" DESTINATION "${package_dir}"
    COMPONENT development)
endif()
foreach(room IN LISTS rooms)
  if(IS_DIRECTORY "${PROJECT_SOURCE_DIR}/src/${room}")
    # Only headers are matched, so folders without one must not be made.
    file(GLOB_RECURSE headers CONFIGURE_DEPENDS RELATIVE "${PROJECT_SOURCE_DIR}/src"
      "${PROJECT_SOURCE_DIR}/src/${room}/*.h")
    list(FILTER headers EXCLUDE REGEX "Impl\\.h$")
    foreach(header IN LISTS headers)
      get_filename_component(folder "${header}" DIRECTORY)
      install(FILES "${PROJECT_SOURCE_DIR}/src/${header}" DESTINATION "${include_dir}/${folder}"
        COMPONENT development)
    endforeach()
  endif()
endforeach()
install(FILES "${VLN_GENERATED_DIR}/GeometryVolume/core/ElementTypesConfig.h"
  DESTINATION "${include_dir}/GeometryVolume/core" COMPONENT development)
if(TARGET vln)
  install(TARGETS vln RUNTIME DESTINATION "${CMAKE_INSTALL_BINDIR}" COMPONENT program)
  if(TARGET vln_manual)
    set(manual_dir "${PROJECT_BINARY_DIR}/manual")
    install(FILES "${manual_dir}/vln.1" DESTINATION "${CMAKE_INSTALL_MANDIR}/man1" COMPONENT program)
    install(FILES "${manual_dir}/vln"
      DESTINATION "${CMAKE_INSTALL_DATADIR}/bash-completion/completions" COMPONENT program)
    install(FILES "${manual_dir}/_vln" DESTINATION "${CMAKE_INSTALL_DATADIR}/zsh/site-functions"
      COMPONENT program)
    install(FILES "${manual_dir}/vln.fish"
      DESTINATION "${CMAKE_INSTALL_DATADIR}/fish/vendor_completions.d" COMPONENT program)
  endif()
endif()

configure_package_config_file("${PROJECT_SOURCE_DIR}/cmake/GeometryVolumeConfig.cmake.in"
  "${PROJECT_BINARY_DIR}/GeometryVolumeConfig.cmake"
  INSTALL_DESTINATION "${package_dir}" NO_CHECK_REQUIRED_COMPONENTS_MACRO)
write_basic_package_version_file("${PROJECT_BINARY_DIR}/GeometryVolumeConfigVersion.cmake"
  VERSION ${PROJECT_VERSION} COMPATIBILITY SameMinorVersion)
install(FILES
  "${PROJECT_BINARY_DIR}/GeometryVolumeConfig.cmake"
  "${PROJECT_BINARY_DIR}/GeometryVolumeConfigVersion.cmake"
  DESTINATION "${package_dir}" COMPONENT development)
