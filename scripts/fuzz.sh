#!/bin/sh
# fuzz.sh [RUNS]: builds fuzz/flat_buffer.cpp with clang's libFuzzer under the address and undefined sanitizers, makes
# seeds with the release build's tests, and runs that many cases (a million). A case that fails is left in build/fuzz.
set -eu
. "$(dirname -- "$0")/lib.sh"
cd "$root"

runs=${1:-1000000}
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
mkdir -p build/fuzz/seeds build/fuzz/corpus
"$clang" -std=c++20 -O2 -g1 -Wall -Wextra -Isrc -Itests \
  -fsanitize=fuzzer,address,undefined -fno-sanitize-recover=all fuzz/flat_buffer.cpp -o build/fuzz/flat_buffer
FLAT_SEEDS=build/fuzz/seeds build/release/bin/test_nanovtt --gtest_filter='FlatFuzz.*Seeds*' >build/fuzz/seeds.log
cd build/fuzz
exec ./flat_buffer -runs="$runs" -max_len=200000 -timeout=20 -print_final_stats=1 -verbosity=0 corpus seeds
