#!/bin/sh
# Builds the Python module, runs its tests, builds a wheel and tests that in a fresh environment, and checks the
# types. Installs the Debian packages that this takes beside those of scripts/install-deps.sh.
# VLN_JOBS limits the parallel jobs, VLN_PYTHON names the interpreter (default: /usr/bin/python3).
set -eu
. "$(dirname -- "$0")/lib.sh"
cd "$root"

python=${VLN_PYTHON:-/usr/bin/python3}
build=build/python
export VLN_PYTHON_BUILD_DIR="$root/$build" VLN_JOBS="$jobs" PYTHONDONTWRITEBYTECODE=1

make_wheel() {
  rm -rf "$build/wheel" "$build/venv"
  "$python" -m pip wheel . --no-deps --no-index --quiet -w "$build/wheel"
}

# The environment sees the system's numpy and pytest, and of vln the wheel alone.
test_wheel() {
  "$python" -m venv --system-site-packages "$build/venv"
  "$build/venv/bin/python" -m pip install --quiet --no-index "$build"/wheel/vln-*.whl
  cd "$build/venv"
  VLN_TEST_DATA_DIR=$data bin/python -m pytest -q -p no:cacheprovider "$root/python/tests"
}

check_types() {
  cd "$build/venv"
  bin/python -m mypy --no-error-summary --cache-dir=/dev/null -p vln
  bin/python -m mypy.stubtest --allowlist "$root/python/stubtest_allow.txt" vln._vln
}

step "install dependencies" sh scripts/install-deps.sh --python
# Beside the main checkout, as cmake/VlnTestData.cmake has it.
data=${VLN_TEST_DATA_DIR:-}
for candidate in "$root/../shared/data" "$(git rev-parse --path-format=absolute --git-common-dir)/../../shared/data"; do
  if [ -z "$data" ] && [ -d "$candidate" ]; then data=$(cd "$candidate" && pwd); fi
done
# Which makes the pages of Volume.view(), where it was built with them.
program="$root/build/release/bin/vln"
if [ -z "${VLN_PROGRAM:-}" ] && [ -x "$program" ]; then export VLN_PROGRAM="$program"; fi
step "wheel" make_wheel
(step "tests of the wheel" test_wheel)
(step "types" check_types)
