#!/bin/sh
# Installs what is missing, configures and builds the release preset, runs every test.
# VLN_JOBS limits the parallel jobs (default: all cores).
set -eu
. "$(dirname -- "$0")/lib.sh"
cd "$root"

step "install dependencies" sh scripts/install-deps.sh
step "configure" cmake --preset release
step "build" cmake --build --preset release -j "$jobs"
step "test" ctest --preset release -j "$jobs"
