#!/bin/sh
# Builds the page of vln view into the program of the release build, and tests it in Chromium. Installs the Debian
# packages that this takes beside those of scripts/install-deps.sh; npm brings the modules of web/package-lock.json.
# VLN_JOBS limits the parallel jobs.
set -eu
. "$(dirname -- "$0")/lib.sh"
cd "$root"

step "install dependencies" sh scripts/install-deps.sh --view
step "configure" cmake --preset release -DVLN_WITH_VIEW=ON
step "build" cmake --build --preset release -j "$jobs" --target vln test_vln
step "test" ctest --preset release -j "$jobs" -R '^vln\..*View'
