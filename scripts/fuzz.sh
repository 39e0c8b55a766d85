#!/bin/sh
# fuzz.sh TARGET [--runs N] [--seconds S]: builds a fuzzer with clang, lets the tests write its seeds, and runs it
# until it has done N cases or S seconds have gone by; a million cases when neither is told. What it learns stays in
# build/fuzz/run/TARGET/corpus; a case that fails is left beside it.
#
# Targets:
#   flat_buffer  validation of flat buffers and .nvtt files, and every lookup in what it accepts
#   filter       filters of channel names
#   operations   sequences of operations on a tree and its channels, held against models
#   ply_file     the bytes of .ply files
#   vdb_file     the bytes of .vdb files, read in a child process as the program does
#   vdb_walk     the same, as far as they are read in the process itself: some hundred times as fast
#   npz_file     the bytes of .npz files
#   vti_file     the bytes of .vti files
set -eu
. "$(dirname -- "$0")/lib.sh"
cd "$root"

usage() {
  sed -n '2,/^set -eu/{/^#/s/^# \{0,1\}//p;}' scripts/fuzz.sh
  exit "$1"
}

target=
runs=
seconds=
while [ $# -gt 0 ]; do
  case $1 in
    --help | -h) usage 0 ;;
    --runs | --seconds)
      case ${2:-} in '' | *[!0-9]*) echo "fuzz.sh: $1 needs a number" >&2 && exit 2 ;; esac
      if [ "$1" = --runs ]; then runs=$2; else seconds=$2; fi
      shift
      ;;
    -*) echo "fuzz.sh: unknown option '$1'" >&2 && usage 2 >&2 ;;
    *) target=$1 ;;
  esac
  shift
done
# Which tests write the seeds; and what a target needs of libFuzzer.
options=
case $target in
  flat_buffer) seeds=nanovtt:FlatFuzz options='-max_len=200000' ;;
  filter) seeds=utils:FilterFuzz options='-max_len=2048' ;;
  # Some 100000 features: weighing them by rarity takes longer than the cases.
  operations) seeds=channels:OperationsFuzz options='-max_len=768 -entropic=0' ;;
  ply_file) seeds=interop:PlyFuzz options="-max_len=4096 -dict=$root/fuzz/ply_file.dict" ;;
  vdb_file) seeds=interop:VdbFuzz options='-max_len=65536' ;;
  vdb_walk) seeds=interop:VdbFuzz options='-max_len=65536' ;;
  npz_file) seeds=interop:NpzFuzz options='-max_len=8192' ;;
  vti_file) seeds=interop:VtiFuzz options='-max_len=8192' ;;
  '') usage 2 >&2 ;;
  *) echo "fuzz.sh: no target '$target'" >&2 && usage 2 >&2 ;;
esac
if [ -z "$runs" ] && [ -z "$seconds" ]; then runs=1000000; fi
clang=
for candidate in clang++-14 clang++; do
  if command -v "$candidate" >/dev/null 2>&1; then
    clang=$candidate
    break
  fi
done
if [ -z "$clang" ]; then
  echo "fuzz.sh: clang is not installed" >&2
  exit 1
fi

folder=build/fuzz/run/$target
mkdir -p "$folder/seeds" "$folder/corpus"
room=${seeds%%:*}
[ -x "build/release/bin/test_$room" ] || {
  echo "fuzz.sh: build the release preset first: its tests write the seeds" >&2
  exit 1
}
step configure cmake --preset fuzz -DCMAKE_CXX_COMPILER="$clang" >"$folder/configure.log"
step build cmake --build build/fuzz -j "$jobs" --target "fuzz_$target" >"$folder/build.log"
FUZZ_SEEDS=$folder/seeds "build/release/bin/test_$room" --gtest_filter="${seeds#*:}.*Seeds*" >"$folder/seeds.log"
cd "$folder"
export LSAN_OPTIONS="suppressions=$root/fuzz/lsan.supp:print_suppressions=0${LSAN_OPTIONS:+:$LSAN_OPTIONS}"
# shellcheck disable=SC2086
exec "$root/build/fuzz/bin/fuzz_$target" ${runs:+-runs="$runs"} ${seconds:+-max_total_time="$seconds"} $options \
  -timeout=60 -rss_limit_mb=3000 -print_final_stats=1 -verbosity=0 \
  corpus seeds
