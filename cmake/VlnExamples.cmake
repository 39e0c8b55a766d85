# One program for each source of examples/ and examples/parts/, run by ctest under the label "examples".
vln_glob(sources examples/*.cpp examples/parts/*.cpp)
foreach(source IN LISTS sources)
  get_filename_component(name "${source}" NAME_WE)
  file(STRINGS "${source}" uses_interop REGEX "#include \"Interop/" LIMIT_COUNT 1)
  if(uses_interop AND NOT TARGET GeometryVolumeInterop)
    message(STATUS "No example ${name}: it needs VLN_BUILD_INTEROP")
    continue()
  endif()
  file(STRINGS "${source}" uses_render REGEX "#include \"Render/" LIMIT_COUNT 1)
  set(target example_${name})
  add_executable(${target} "${source}")
  vln_target(${target})
  target_link_libraries(${target} PRIVATE GeometryVolume)
  if(TARGET GeometryVolumeInterop)
    target_link_libraries(${target} PRIVATE GeometryVolumeInterop)
  endif()
  if(uses_render)
    target_link_libraries(${target} PRIVATE GeometryVolumeRender)
  endif()
  if(VLN_BUILD_TESTS)
    set(folder "${PROJECT_BINARY_DIR}/examples/${name}")
    file(MAKE_DIRECTORY "${folder}")
    add_test(NAME examples.${name} COMMAND ${target} WORKING_DIRECTORY "${folder}")
    set_tests_properties(examples.${name} PROPERTIES LABELS examples TIMEOUT 600)
  endif()
endforeach()

# What the documents show is what these programs do.
find_program(VLN_PYTHON3 python3)
mark_as_advanced(VLN_PYTHON3)
if(VLN_BUILD_TESTS AND VLN_PYTHON3)
  add_test(NAME examples.documents
    COMMAND "${VLN_PYTHON3}" "${PROJECT_SOURCE_DIR}/scripts/check_snippets")
  set_tests_properties(examples.documents PROPERTIES LABELS examples TIMEOUT 60)
  if(TARGET example_reading_flat) # reads the file that the example leaves in its folder
    add_test(NAME examples.read_nvtt
      COMMAND "${VLN_PYTHON3}" "${PROJECT_SOURCE_DIR}/examples/python/read_nvtt.py" flat.nvtt density 3 4 5
      WORKING_DIRECTORY "${PROJECT_BINARY_DIR}/examples/reading_flat")
    set_tests_properties(examples.reading_flat PROPERTIES FIXTURES_SETUP flat_file)
    set_tests_properties(examples.read_nvtt PROPERTIES LABELS examples TIMEOUT 60 FIXTURES_REQUIRED flat_file
      PASS_REGULAR_EXPRESSION "^31.0")
  endif()
endif()
