# The scripts of web/, bundled with the modules of its lockfile, as a source of the program. Without VLN_WITH_VIEW
# an empty one: `vln view` then says what is missing.
set(view_source "${VLN_GENERATED_DIR}/ViewScript.cpp")
set(view_bundle)
set(view_folder "${PROJECT_BINARY_DIR}/web")

if(VLN_WITH_VIEW)
  find_program(VLN_NODE node)
  find_program(VLN_NPM npm)
  if(NOT VLN_NODE OR NOT VLN_NPM)
    message(FATAL_ERROR "VLN_WITH_VIEW needs node and npm: sh scripts/install-deps.sh --view installs them")
  endif()
  # The modules lie in the build folder, as the lockfile has them; those of the tests only with tests.
  set(omit --omit=dev)
  if(VLN_BUILD_TESTS)
    set(omit)
  endif()
  file(MAKE_DIRECTORY "${view_folder}")
  add_custom_command(
    OUTPUT "${view_folder}/node_modules/.package-lock.json"
    COMMAND "${CMAKE_COMMAND}" -E copy
      "${PROJECT_SOURCE_DIR}/web/package.json" "${PROJECT_SOURCE_DIR}/web/package-lock.json" "${view_folder}"
    COMMAND "${VLN_NPM}" ci --ignore-scripts --no-audit --no-fund --loglevel=error ${omit}
    COMMAND "${CMAKE_COMMAND}" -E touch node_modules/.package-lock.json
    WORKING_DIRECTORY "${view_folder}"
    DEPENDS "${PROJECT_SOURCE_DIR}/web/package.json" "${PROJECT_SOURCE_DIR}/web/package-lock.json"
    COMMENT "Installing the modules of web/package-lock.json"
    VERBATIM)
  vln_glob(view_scripts web/src/*.js web/src/*.glsl web/src/*.css)
  set(view_bundle "${view_folder}/view.js")
  add_custom_command(
    OUTPUT "${view_bundle}"
    COMMAND "${CMAKE_COMMAND}" -E env "NODE_PATH=${view_folder}/node_modules"
      "${VLN_NODE}" "${view_folder}/node_modules/esbuild/bin/esbuild" "${PROJECT_SOURCE_DIR}/web/src/main.js"
      --bundle --minify --format=iife --target=es2022 --charset=utf8 --legal-comments=inline
      --loader:.glsl=text --loader:.css=text --log-level=warning "--outfile=${view_bundle}"
    DEPENDS ${view_scripts} "${view_folder}/node_modules/.package-lock.json"
    COMMENT "Bundling the scripts of vln view"
    VERBATIM)
else()
  message(STATUS "VLN_WITH_VIEW is OFF: vln view is left out, which would need node and npm")
endif()

add_custom_command(
  OUTPUT "${view_source}"
  COMMAND "${CMAKE_COMMAND}" "-DIN=${view_bundle}" "-DLICENSE=${view_folder}/node_modules/lil-gui/LICENSE.md" "-DOUT=${view_source}"
    -P "${PROJECT_SOURCE_DIR}/cmake/EmbedView.cmake"
  DEPENDS ${view_bundle} "${PROJECT_SOURCE_DIR}/cmake/EmbedView.cmake"
  COMMENT "" VERBATIM)
target_sources(vln PRIVATE "${view_source}")
