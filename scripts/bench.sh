#!/bin/sh
# bench.sh [ARGUMENTS]: builds and runs every benchmark and writes the figures to docs/benchmarks.md, above the line
# there below which figures are measured by hand.
# Arguments go to each binary, such as --benchmark_filter=REGEX or --benchmark_min_time=0.1;
# with any, the table goes to standard output and the document stays as it is.
set -eu
. "$(dirname -- "$0")/lib.sh"
cd "$root"

sh scripts/install-deps.sh >&2
cmake --preset bench >&2
cmake --build --preset bench -j "$jobs" >&2

results=$(mktemp -d)
trap 'rm -rf "$results"' EXIT
found=
for source in bench/*.cpp; do
  name=$(basename -- "$source" .cpp)
  binary=build/bench/bench/bench_$name
  [ -x "$binary" ] || continue
  found=1
  echo "==> $name" >&2
  "$binary" --benchmark_out="$results/$name.json" --benchmark_out_format=json "$@" >&2
done
if [ -z "$found" ]; then
  echo "bench: there is no benchmark in bench/" >&2
  exit 1
fi

if [ $# -gt 0 ]; then
  python3 scripts/bench_table.py build/bench "$results"/*.json
else
  mkdir -p docs
  python3 scripts/bench_table.py build/bench "$results"/*.json >"$results/table.md"
  sed -n '/^<!-- What stands below is measured by hand/,$p' docs/benchmarks.md >>"$results/table.md"
  mv "$results/table.md" docs/benchmarks.md
  echo "bench: wrote docs/benchmarks.md" >&2
fi
