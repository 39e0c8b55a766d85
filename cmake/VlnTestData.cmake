# Sets vln_test_data to the folder of real input files, empty when there is none.
if(NOT VLN_TEST_DATA_DIR)
  set(candidates "${PROJECT_SOURCE_DIR}/../shared/data")
  execute_process(COMMAND git rev-parse --path-format=absolute --git-common-dir
    WORKING_DIRECTORY "${PROJECT_SOURCE_DIR}" OUTPUT_VARIABLE common ERROR_QUIET
    OUTPUT_STRIP_TRAILING_WHITESPACE)
  if(common)
    list(APPEND candidates "${common}/../../shared/data")
  endif()
  set(vln_test_data "")
  foreach(candidate IN LISTS candidates)
    if(IS_DIRECTORY "${candidate}" AND NOT vln_test_data)
      get_filename_component(vln_test_data "${candidate}" ABSOLUTE)
    endif()
  endforeach()
else()
  set(vln_test_data "${VLN_TEST_DATA_DIR}")
endif()
