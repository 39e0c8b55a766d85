# Chooses what lies behind the six vlje_ functions; see src/vljemalloc/vljemalloc.h.

# vln_allocator(TARGET): adds the sources and definitions of the chosen back end.
function(vln_allocator target)
  string(TOUPPER ${VLN_ALLOCATOR} upper)
  set_property(SOURCE "${PROJECT_SOURCE_DIR}/src/vljemalloc/vljemalloc.cpp" APPEND PROPERTY
    COMPILE_DEFINITIONS VLJE_BACKEND_${upper}=1)
  if(VLN_ALLOCATOR STREQUAL "prefixed")
    find_library(VLN_JEMALLOC_ARCHIVE NAMES libjemalloc_pic.a NO_CACHE)
    if(NOT VLN_JEMALLOC_ARCHIVE)
      message(FATAL_ERROR "VLN_ALLOCATOR=prefixed needs jemalloc's static library libjemalloc_pic.a "
        "(Debian: libjemalloc-dev); or choose VLN_ALLOCATOR=linked or system")
    endif()
    set(object "${VLN_GENERATED_DIR}/vljemalloc/jemalloc_renamed.o")
    set(script "${PROJECT_SOURCE_DIR}/cmake/RenameJemalloc.cmake")
    add_custom_command(OUTPUT "${object}"
      COMMAND "${CMAKE_COMMAND}"
        "-DARCHIVE=${VLN_JEMALLOC_ARCHIVE}" "-DOUTPUT=${object}"
        "-DAR=${CMAKE_AR}" "-DLD=${CMAKE_LINKER}" "-DNM=${CMAKE_NM}" "-DOBJCOPY=${CMAKE_OBJCOPY}"
        -P "${script}"
      DEPENDS "${VLN_JEMALLOC_ARCHIVE}" "${script}"
      COMMENT "Renaming the symbols of ${VLN_JEMALLOC_ARCHIVE}"
      VERBATIM)
    set_source_files_properties("${object}" PROPERTIES EXTERNAL_OBJECT TRUE GENERATED TRUE)
    target_sources(${target} PRIVATE "${object}")
    target_link_libraries(${target} PRIVATE Threads::Threads m ${CMAKE_DL_LIBS})
  elseif(VLN_ALLOCATOR STREQUAL "linked")
    find_path(VLN_JEMALLOC_INCLUDE_DIR jemalloc/jemalloc.h REQUIRED)
    find_library(VLN_JEMALLOC_LIBRARY NAMES libjemalloc.so REQUIRED)
    target_include_directories(${target} SYSTEM PRIVATE "${VLN_JEMALLOC_INCLUDE_DIR}")
    target_link_libraries(${target} PRIVATE "${VLN_JEMALLOC_LIBRARY}")
  endif()
endfunction()
