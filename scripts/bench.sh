#!/bin/sh
# bench.sh [ARGUMENTS]
#   builds and runs every benchmark and writes the figures to docs/benchmarks.md, above the line there below which
#   figures are measured by hand. Arguments go to each binary, such as --benchmark_filter=REGEX or
#   --benchmark_min_time=0.1; with any, the table goes to standard output and the document stays as it is.
# bench.sh --quick [--save FILE] [--against FILE]
#   the short table alone, in about three minutes once built: ours beside the best peer, to standard output and in
#   place of the one in docs/benchmarks.md. --save keeps the figures, --against compares with kept ones, and the
#   document stays as it is then.
set -eu
. "$(dirname -- "$0")/lib.sh"
cd "$root"

quick=
save=
against=
if [ "${1:-}" = --quick ]; then
  quick=1
  shift
  while [ $# -gt 0 ]; do
    case $1 in
      --save | --against)
        [ -n "${2:-}" ] || { echo "bench.sh: $1 needs a file" >&2 && exit 2; }
        if [ "$1" = --save ]; then save=$2; else against=$2; fi
        shift 2
        ;;
      *) echo "bench.sh: unknown option '$1'" >&2 && exit 2 ;;
    esac
  done
  if [ -n "$against" ] && [ ! -r "$against" ]; then
    echo "bench.sh: $against cannot be read" >&2
    exit 1
  fi
fi

sh scripts/install-deps.sh >&2
cmake --preset bench >&2
cmake --build --preset bench -j "$jobs" >&2

results=$(mktemp -d)
trap 'rm -rf "$results"' EXIT

# The short table's own runs, into $results/story.
run_story() {
  mkdir "$results/story"
  python3 scripts/bench_story.py filters | while IFS="$(printf '\t')" read -r name filter; do
    echo "==> $name" >&2
    "build/bench/bench/bench_$name" --benchmark_filter="$filter" --benchmark_repetitions=5 \
      --benchmark_enable_random_interleaving=true --benchmark_min_time=0.05 \
      --benchmark_out="$results/story/$name.json" --benchmark_out_format=json >&2
  done
}
# Puts the short table between the lines of docs/benchmarks.md that mark it.
put_story() {
  begin='<!-- The short table, by bench.sh --quick -->' end='<!-- The end of the short table -->'
  awk -v begin="$begin" -v end="$end" -v table="$1" '
    $0 == begin { print; print ""; while ((getline line < table) > 0) print line; print ""; skip = 1 }
    $0 == end { skip = 0 }
    !skip && $0 != begin' docs/benchmarks.md >"$results/document.md"
  cat "$results/document.md" >docs/benchmarks.md
}

if [ -n "$quick" ]; then
  run_story
  if [ -n "$save" ]; then python3 scripts/bench_story.py merge "$save" "$results"/story/*.json; fi
  if [ -n "$against" ]; then
    python3 scripts/bench_story.py table --against "$against" "$results"/story/*.json
  else
    python3 scripts/bench_story.py table "$results"/story/*.json | tee "$results/story.md"
    if [ -z "$save" ]; then put_story "$results/story.md"; fi
  fi
  exit 0
fi

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
  run_story
  mkdir -p docs
  python3 scripts/bench_table.py build/bench "$results"/*.json >"$results/table.md"
  sed -n '/^<!-- What stands below is measured by hand/,$p' docs/benchmarks.md >>"$results/table.md"
  mv "$results/table.md" docs/benchmarks.md
  python3 scripts/bench_story.py table "$results"/story/*.json >"$results/story.md"
  put_story "$results/story.md"
  echo "bench: wrote docs/benchmarks.md" >&2
fi
