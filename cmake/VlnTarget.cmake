# Flags that all targets of the project share, and small helpers.

set(VLN_GENERATED_DIR "${PROJECT_BINARY_DIR}/generated")

# vln_target(TARGET): compile options, sanitizers and include paths.
function(vln_target target)
  target_compile_features(${target} PRIVATE cxx_std_20)
  # No contraction: documented formulas must not turn into fused multiply-adds.
  target_compile_options(${target} PRIVATE
    -ffp-contract=off
    -Wall -Wextra -Wpedantic -Wshadow -Wnon-virtual-dtor -Woverloaded-virtual)
  if(VLN_WERROR)
    target_compile_options(${target} PRIVATE -Werror)
  endif()
  if(VLN_SANITIZE)
    target_compile_options(${target} PRIVATE
      -fsanitize=${VLN_SANITIZE} -fno-sanitize-recover=all -fno-omit-frame-pointer
      # The added checks make this warning fire inside the standard library's own headers.
      -Wno-maybe-uninitialized)
    target_link_options(${target} PRIVATE -fsanitize=${VLN_SANITIZE})
  endif()
endfunction()

# vln_glob(OUT PATTERN...): sources below the project's root, watched for additions.
function(vln_glob out)
  list(TRANSFORM ARGN PREPEND "${PROJECT_SOURCE_DIR}/" OUTPUT_VARIABLE patterns)
  file(GLOB sources CONFIGURE_DEPENDS LIST_DIRECTORIES false ${patterns})
  set(${out} "${sources}" PARENT_SCOPE)
endfunction()

# vln_folders(OUT PARENT): names of the folders directly below PARENT that hold a source.
function(vln_folders out parent)
  file(GLOB sources CONFIGURE_DEPENDS LIST_DIRECTORIES false
    "${PROJECT_SOURCE_DIR}/${parent}/*/*.cpp" "${PROJECT_SOURCE_DIR}/${parent}/*/*.cpp.in")
  set(names)
  foreach(source IN LISTS sources)
    get_filename_component(folder "${source}" DIRECTORY)
    get_filename_component(name "${folder}" NAME)
    list(APPEND names ${name})
  endforeach()
  list(REMOVE_DUPLICATES names)
  set(${out} "${names}" PARENT_SCOPE)
endfunction()

# vln_uses_openvdb(TARGET): for a target whose sources include OpenVDB's headers. They need default
# visibility: std::call_once of OpenVDB's own functions may be bound to the copy compiled here, and
# that copy must then set the variables of the process, not hidden ones of this target.
function(vln_uses_openvdb target)
  target_link_libraries(${target} PRIVATE OpenVDB::openvdb)
  set_target_properties(${target} PROPERTIES
    CXX_VISIBILITY_PRESET default VISIBILITY_INLINES_HIDDEN OFF)
endfunction()
