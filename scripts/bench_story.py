"""The short table of the benchmarks: ours beside the best peer, worst and best rows first.

bench_story.py filters            the binaries that it needs, each with the filter of its rows
bench_story.py table [--against SAVED] RESULT.json...
                                  the table in Markdown. RESULT are Google Benchmark's results with repetitions;
                                  SAVED is what an earlier run was merged into
bench_story.py merge OUT RESULT.json...
                                  one file of the figures alone, to compare with later
"""

import json
import os
import re
import statistics
import sys

from bench_table import TO_NS
from bench_table import date_and_commit
from bench_table import time as shown

GRIDS = ["bunny_ls_512_half", "smoke", "sphere_200"]


def of_grids(label, ours, *peers):
    """A row for each grid of the benchmark `exchange`."""
    return [(f"{label}, {g}", "exchange", f"{g}/{ours}", [f"{g}/{p}" for p in peers]) for g in GRIDS]


def of_positions(label, ours, *peers):
    """A row for each pattern of positions of the benchmark `sampling`."""
    patterns = ["at random", "rays across", "rays in the band"]
    return [(f"{label}, {name}", "sampling", f"{ours}/pattern:{n}", [f"{p}/pattern:{n}" for p in peers])
            for n, name in enumerate(patterns)]


# What is compared, binary, our benchmark, those of the peers.
ROWS = [
    *of_grids("read a whole file, 2 threads", "file/importVdb/threads:2/real_time",
              "file/OpenVDB getGrids/threads:2/real_time"),
    *of_grids("random read, accessor", "read/random/accessor/real_time", "read/random/OpenVDB/real_time"),
    *of_grids("random read, reader", "read/random/ChannelReader/real_time",
              "read/random/OpenVDB/real_time", "read/random/NanoVDB/real_time"),
    *of_grids("random read, reader, many at once", "read/random/ChannelReader, many at once/real_time",
              "read/random/OpenVDB, stored/real_time", "read/random/NanoVDB, stored/real_time"),
    *of_grids("coherent read, reader", "read/coherent/ChannelReader/real_time",
              "read/coherent/OpenVDB/real_time", "read/coherent/NanoVDB/real_time"),
    *of_grids("coherent read, reader, many at once", "read/coherent/ChannelReader, many at once/real_time",
              "read/coherent/OpenVDB, stored/real_time", "read/coherent/NanoVDB, stored/real_time"),
    *of_grids("sum over active voxels, 1 thread", "sum/traversal/threads:1/real_time",
              "sum/OpenVDB/threads:1/real_time"),
    *of_grids("one tile after another", "topology/ordered/addTile/real_time",
              "topology/ordered/OpenVDB touchLeaf/real_time"),
    *of_grids("tiles in bulk with values, 1 thread", "topology/ordered/bulk with values/threads:1/real_time",
              "topology/ordered/OpenVDB touchLeaf/real_time"),
    *of_grids("tiles in bulk with zeros, 1 thread", "topology/ordered/bulk with zeros/threads:1/real_time",
              "topology/ordered/OpenVDB touchLeaf/real_time"),
    *of_positions("trilinear, wide channel", "wide channel", "OpenVDB BoxSampler", "NanoVDB trilinear"),
    *of_positions("trilinear, wide channel, many at once", "wide channel, many at once",
                  "OpenVDB BoxSampler", "NanoVDB trilinear"),
    *of_positions("trilinear, core channel", "core channel", "OpenVDB BoxSampler", "NanoVDB trilinear"),
    *of_positions("with gradient, wide channel", "wide channel with gradient", "NanoVDB trilinear with gradient"),
    ("refine, 1 thread", "treechange", "BM_Refine/1/manual_time", ["BM_TopologyUnion/1/manual_time"]),
    ("refine, 2 threads", "treechange", "BM_Refine/2/manual_time", ["BM_TopologyUnion/2/manual_time"]),
    ("points moved by 0.37 voxels, 1 thread", "treechange", "BM_ReTile/1/0/1/min_time:1.000/manual_time",
     ["BM_MovePointsVdb/1/0/1/min_time:1.000/manual_time"]),
    ("points moved by 4 voxels, 1 thread", "treechange", "BM_ReTile/1/1/1/min_time:1.000/manual_time",
     ["BM_MovePointsVdb/1/1/1/min_time:1.000/manual_time"]),
    ("write one value, new, in order", "volume", "BM_FieldSet/0/0", ["BM_VdbSetValue/0/0"]),
    ("write one value, new, at random", "volume", "BM_FieldSet/1/0", ["BM_VdbSetValue/1/0"]),
    ("write one value again, at random", "volume", "BM_FieldSet/1/1", ["BM_VdbSetValue/1/1"]),
    ("write in bulk, new, in order, 2 threads", "volume", "BM_FieldSetBulk/0/0/2/real_time",
     ["BM_VdbSetValue/0/0"]),
    ("write in bulk, new, a band by leaves, 2 threads", "volume", "BM_FieldSetBulk/2/0/2/real_time",
     ["BM_VdbSetValue/2/0"]),
    ("write in bulk, new, at random, 2 threads", "volume", "BM_FieldSetBulk/1/0/2/real_time",
     ["BM_VdbSetValue/1/0"]),
    ("read in bulk, in order, 1 thread", "volume", "BM_FieldGetBulk/0/1/real_time", ["BM_VdbGetValue/0"]),
    ("read in bulk, at random, 1 thread", "volume", "BM_FieldGetBulk/1/1/real_time", ["BM_VdbGetValue/1"]),
    *[(f"read {what} of a flat buffer with cells, {grid}", "flatten",
       f"{grid}/{name}/ours, {ours}", [f"{grid}/{name}/NanoVDB"])
      for grid in GRIDS
      for what, name, ours in (("at random", "read/random", "type known, cells"),
                               ("coherently", "read/coherent", "type known, cells"),
                               ("blends at random", "trilinear/random", "halo tiles, type known, cells"))],
    ("flatten float, bunny, 2 threads", "flatten", "bunny_ls_512_half/flatten/ours float/threads:2/real_time",
     ["bunny_ls_512_half/flatten/NanoVDB float/threads:2/real_time"]),
    ("flatten Fp8, bunny, 2 threads", "flatten", "bunny_ls_512_half/flatten/ours Fp8/threads:2/real_time",
     ["bunny_ls_512_half/flatten/NanoVDB Fp8/threads:2/real_time"]),
]


def filters():
    binaries = {}
    for _, binary, ours, peers in ROWS:
        binaries.setdefault(binary, []).extend([ours, *peers])
    for binary, names in binaries.items():
        escaped = "|".join(re.escape(n).replace("\\ ", " ") for n in dict.fromkeys(names))
        print(f"{binary}\t^({escaped})$")


def read(paths):
    """Nanoseconds of every repetition, by binary and name."""
    times = {}
    for path in paths:
        with open(path, encoding="utf-8") as file:
            result = json.load(file)
        if "benchmarks" not in result:
            for key, values in result.items():
                times[tuple(key.split(":", 1))] = values
            continue
        binary = os.path.basename(path)[: -len(".json")]
        for run in result["benchmarks"]:
            if run.get("run_type") == "aggregate" or "real_time" not in run:
                continue
            name = re.sub(r"/repeats:\d+", "", run.get("run_name", run["name"]))
            # Wall time only where a benchmark asks for it: other programs run on the machine too.
            field = "real_time" if name.endswith(("real_time", "manual_time")) else "cpu_time"
            times.setdefault((binary, name), []).append(run[field] * TO_NS[run["time_unit"]])
    return times


def spread(values):
    """How far the repetitions lie from their median at most, in percent."""
    middle = statistics.median(values)
    return max(abs(v - middle) for v in values) / middle * 100


def compare(times):
    rows = []
    for label, binary, ours, peers in ROWS:
        mine = times.get((binary, ours))
        found = {p: times[binary, p] for p in peers if (binary, p) in times}
        if not mine or not found:
            continue
        best = min(found, key=lambda p: statistics.median(found[p]))
        ratio = statistics.median(found[best]) / statistics.median(mine)
        rows.append((ratio, label, mine, best, found[best]))
    return sorted(rows, key=lambda row: row[0])


def peer_name(name):
    return "NanoVDB" if "NanoVDB" in name else "OpenVDB"


def table(arguments):
    saved = {}
    if arguments[:1] == ["--against"]:
        saved = {row[1]: row[0] for row in compare(read([arguments[1]]))}
        arguments = arguments[2:]
    rows = compare(read(arguments))
    if not rows:
        print("bench: no result has a row of the short table", file=sys.stderr)
        return 1
    head = ["what", "peer / ours", "ours", "best peer", "spread of ours, peer"]
    if saved:
        head.insert(2, "saved run")
    def show(part):
        print("| " + " | ".join(head) + " |")
        print("|---" + "|---:" * (len(head) - 1) + "|")
        for ratio, label, mine, best, theirs in part:
            cells = [label, f"**{ratio:.2f}**", shown(statistics.median(mine)),
                     f"{shown(statistics.median(theirs))} {peer_name(best)}",
                     f"{spread(mine):.0f} %, {spread(theirs):.0f} %"]
            if saved:
                before = saved.get(label)
                cells.insert(2, f"{before:.2f}, now x {ratio / before:.2f}" if before else "")
            print("| " + " | ".join(cells) + " |")
    print("Time of the best peer by ours, both in this run: above 1 we are ahead. Medians of interleaved "
          f"repetitions; the spread is the largest distance from the median. {date_and_commit()}.\n")
    print("The worst rows:\n")
    show(rows[:8])
    print("\nThe best rows:\n")
    show(rows[::-1][:8])
    if len(rows) > 16:
        print("\nThe others, from the worst on:\n")
        show(rows[8:-8])
    return 0


def merge(out, paths):
    with open(out, "w", encoding="utf-8") as file:
        json.dump({":".join(key): values for key, values in read(paths).items()}, file, indent=0)


def main():
    command, arguments = sys.argv[1], sys.argv[2:]
    if command == "filters":
        return filters()
    if command == "merge":
        return merge(arguments[0], arguments[1:])
    return table(arguments)


if __name__ == "__main__":
    sys.exit(main())
