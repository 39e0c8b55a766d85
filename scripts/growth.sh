#!/bin/sh
# growth.sh [MILLIONS...]: how time and memory grow with a volume, for level sets of so many million voxels (1, 10,
# 100 and 500 without arguments; the last takes some 20 GB of memory). Draws docs/images/growth.svg and prints a
# table with the exponents that fit: 1 is linear.
set -eu
. "$(dirname -- "$0")/lib.sh"
cd "$root"

for size in "$@"; do
  case $size in '' | *[!0-9.]*) echo "growth.sh: '$size' is no number of millions" >&2 && exit 2 ;; esac
done
[ $# -gt 0 ] || set -- 1 10 100 500

sh scripts/install-deps.sh >&2
cmake --preset bench >&2
cmake --build --preset bench -j "$jobs" --target growth >&2

results=$(mktemp -d)
trap 'rm -rf "$results"' EXIT
for size in "$@"; do
  echo "==> $size million voxels" >&2
  build/bench/bench/growth "$size" | tee "$results/$size.json" >&2
done
python3 scripts/growth_plot.py docs/images/growth.svg "$results"/*.json
