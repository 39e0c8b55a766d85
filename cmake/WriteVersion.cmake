# Writes OUTPUT from TEMPLATE with the version, the commit and the build date; the file is touched
# only when its content changes. In: SOURCE_DIR, VERSION, TEMPLATE, OUTPUT.

function(git out fallback)
  execute_process(COMMAND git ${ARGN} WORKING_DIRECTORY "${SOURCE_DIR}"
    RESULT_VARIABLE rc OUTPUT_VARIABLE text ERROR_QUIET OUTPUT_STRIP_TRAILING_WHITESPACE)
  if(NOT rc EQUAL 0 OR text STREQUAL "")
    set(text "${fallback}")
  endif()
  set(${out} "${text}" PARENT_SCOPE)
endfunction()

git(VERSION_COMMIT "unknown" rev-parse --short=12 HEAD)
git(VERSION_BRANCH "unknown" rev-parse --abbrev-ref HEAD)
git(VERSION_BUILD "0" rev-list --count HEAD)
# string(TIMESTAMP) itself takes SOURCE_DATE_EPOCH from the environment.
string(TIMESTAMP VERSION_DATE "%Y-%m-%d" UTC)
string(REPLACE "." ";" numbers "${VERSION}")
list(GET numbers 0 VERSION_MAJOR)
list(GET numbers 1 VERSION_MINOR)
list(GET numbers 2 VERSION_PATCH)
configure_file("${TEMPLATE}" "${OUTPUT}" @ONLY)
