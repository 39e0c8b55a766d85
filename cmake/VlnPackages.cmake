# Debian packages by CPack, one for each component of the install rules:
#
#   library      libgeometryvolume0.1           the library and the renderer
#   interop      libgeometryvolume-interop0.1   files of other formats, with OpenVDB
#   development  libgeometryvolume-dev          headers, links for the linker, the CMake package
#   program      vln                            the program, its manual page and completions
#   python       python3-vln                    the Python module; out of a build of its own, see scripts/deb.sh
#
# Dependencies on other packages' libraries are found by dpkg-shlibdeps, the rest stands here.
set(library_version "${PROJECT_VERSION_MAJOR}.${PROJECT_VERSION_MINOR}") # as in SOVERSION
set(same_version "(= ${PROJECT_VERSION})")

set(CPACK_GENERATOR DEB)
set(CPACK_PACKAGE_NAME geometryvolume)
set(CPACK_PACKAGE_VERSION "${PROJECT_VERSION}")
set(CPACK_PACKAGE_DESCRIPTION_SUMMARY "${PROJECT_DESCRIPTION}")
set(CPACK_PACKAGE_CONTACT "GeometryVolume developers <geometryvolume@localhost>" CACHE STRING
  "Whom the packages name as their maintainer")
set(CPACK_PACKAGING_INSTALL_PREFIX /usr)
set(CPACK_STRIP_FILES ON)
set(CPACK_VERBATIM_VARIABLES ON)
set(CPACK_DEB_COMPONENT_INSTALL ON)
set(CPACK_COMPONENTS_GROUPING ONE_PER_GROUP)
set(CPACK_DEBIAN_FILE_NAME DEB-DEFAULT)
# For folders that the packages make, whatever the umask of who builds them.
set(CPACK_INSTALL_DEFAULT_DIRECTORY_PERMISSIONS
  OWNER_READ OWNER_WRITE OWNER_EXECUTE GROUP_READ GROUP_EXECUTE WORLD_READ WORLD_EXECUTE)

if(VLN_BUILD_PYTHON)
  # The extension holds the libraries whole: nothing else of such a build is of use.
  set(CPACK_COMPONENTS_ALL python)
else()
  set(CPACK_COMPONENTS_ALL library development)
  if(TARGET GeometryVolumeInterop)
    list(APPEND CPACK_COMPONENTS_ALL interop)
  endif()
  if(TARGET vln)
    list(APPEND CPACK_COMPONENTS_ALL program)
  endif()
endif()

# vln_package(COMPONENT NAME SECTION DESCRIPTION): the project's own description stands before it.
macro(vln_package component name section description)
  string(TOUPPER ${component} key)
  set(CPACK_DEBIAN_${key}_PACKAGE_NAME ${name})
  set(CPACK_DEBIAN_${key}_PACKAGE_SECTION ${section})
  set(CPACK_DEBIAN_${key}_PACKAGE_SHLIBDEPS ON)
  set(CPACK_DEBIAN_${key}_DESCRIPTION "${description}")
endmacro()

set(library_package "libgeometryvolume${library_version}")
set(interop_package "libgeometryvolume-interop${library_version}")
vln_package(library ${library_package} libs
  "The library, and a renderer of flat buffers.")
vln_package(interop ${interop_package} libs
  "Reads and writes .vdb, .nvdb and other files of volumes, points and meshes.")
vln_package(development libgeometryvolume-dev libdevel
  "Headers, and the package for find_package(GeometryVolume).")
vln_package(program vln graphics
  "The program: shows, samples, renders and converts volumes.")
vln_package(python python3-vln python
  "The Python module: opens, samples, changes and saves volumes as numpy arrays.")

set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS_PRIVATE_DIRS "${PROJECT_BINARY_DIR}/lib")
set(CPACK_DEBIAN_LIBRARY_PACKAGE_CONTROL_STRICT_PERMISSION ON)
set(CPACK_DEBIAN_INTEROP_PACKAGE_DEPENDS "${library_package} ${same_version}")
set(CPACK_DEBIAN_PROGRAM_PACKAGE_DEPENDS "${library_package} ${same_version}, ${interop_package} ${same_version}")
if(vln_hdf5)
  # Loaded when .vtkhdf files are written, which dpkg-shlibdeps cannot see.
  execute_process(COMMAND dpkg-query --search "${vln_hdf5_file}" OUTPUT_VARIABLE hdf5_package ERROR_QUIET)
  string(REGEX REPLACE "[:,].*" "" hdf5_package "${hdf5_package}")
  if(hdf5_package)
    set(CPACK_DEBIAN_INTEROP_PACKAGE_RECOMMENDS "${hdf5_package}")
    set(CPACK_DEBIAN_PYTHON_PACKAGE_RECOMMENDS "${hdf5_package}")
  endif()
endif()
# What find_package() looks for: oneTBB always, with the component Interop the rest.
set(CPACK_DEBIAN_DEVELOPMENT_PACKAGE_SHLIBDEPS OFF)
set(development_depends "${library_package} ${same_version}" libtbb-dev)
if(TARGET GeometryVolumeInterop)
  list(APPEND development_depends "${interop_package} ${same_version}")
  set(CPACK_DEBIAN_DEVELOPMENT_PACKAGE_RECOMMENDS "libopenvdb-dev, libboost-iostreams-dev, libimath-dev, libpng-dev")
endif()
list(JOIN development_depends ", " CPACK_DEBIAN_DEVELOPMENT_PACKAGE_DEPENDS)
if(VLN_BUILD_PYTHON)
  math(EXPR next_minor "${Python3_VERSION_MINOR} + 1")
  set(CPACK_DEBIAN_PYTHON_PACKAGE_DEPENDS
    "python3 (>= 3.${Python3_VERSION_MINOR}), python3 (<< 3.${next_minor}), python3-numpy")
endif()

include(CPack)
