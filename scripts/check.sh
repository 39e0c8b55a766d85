#!/bin/sh
# Every check that is not a test: format, layers, headers, install, absolute paths, clang-tidy. Runs them all
# and fails when one fails.
set -eu
. "$(dirname -- "$0")/lib.sh"
cd "$root"

step "install dependencies" sh scripts/install-deps.sh --checks
failed=
for check in check_format check_layers check_paths check_snippets check_headers check_install check_tidy; do
  step "$check" "scripts/$check" || failed="$failed $check"
done
if [ -n "$failed" ]; then
  echo "check: failed:$failed" >&2
  exit 1
fi
echo "check: all passed"
