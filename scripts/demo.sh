#!/bin/sh
# demo.sh [FILE.vdb]: shows a volume as numbers and as a picture. Without a file it first makes a
# cloud of about a million voxels.
set -eu
. "$(dirname -- "$0")/lib.sh"

file=
if [ $# -gt 0 ]; then
  if [ ! -r "$1" ]; then
    echo "demo: cannot read $1" >&2
    exit 1
  fi
  file=$(CDPATH='' cd -- "$(dirname -- "$1")" && pwd)/$(basename -- "$1")
fi
cd "$root"
folder=$(mktemp -d "${TMPDIR:-/tmp}/vln-demo.XXXXXX")

# Building is talk for the side: what the demo shows goes to standard output.
{
  sh scripts/install-deps.sh
  # What the demo does not show need not be compiled for it; scripts/test.sh turns it on again.
  lean=
  if [ ! -f build/release/CMakeCache.txt ]; then lean=-DVLN_WITH_CONVERTERS=OFF; fi
  cmake --preset release $lean >"$folder/configure.log" || { cat "$folder/configure.log"; exit 1; }
  if ! cmake --build --preset release --target help | grep -q '^vln:'; then
    echo "demo: this checkout has no program vln"
    exit 1
  fi
  cmake --build --preset release -j "$jobs" --target vln
} >&2
vln=build/release/bin/vln

if [ -z "$file" ]; then
  file=$folder/cloud.vdb
  echo "\$ vln make cloud $file --voxels 1000000"
  "$vln" make cloud "$file" --voxels 1000000
fi

echo "\$ vln info $file"
"$vln" info "$file"
"$vln" info "$file" --json >"$folder/info.json"
channel=$(python3 - "$folder/info.json" <<'PYTHON'
import json, sys
with open(sys.argv[1], encoding="utf-8") as file:
    objects = json.load(file)["objects"]
for channels in (o["channels"] for o in objects if o["channels"]):
    print(channels[0]["name"])
    break
PYTHON
)
if [ -z "$channel" ]; then
  echo "demo: $file has no channel to look at" >&2
  exit 1
fi

picture=$folder/slice.png
echo "\$ vln slice $file --channel $channel --axis z -o $picture"
"$vln" slice "$file" --channel "$channel" --axis z -o "$picture"
echo "picture: $picture"
