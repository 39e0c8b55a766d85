"""bench_table.py BUILD RESULT.json...: one Markdown document out of Google Benchmark's results.

BUILD is the build folder they came from; compiler and flags are read from it.
"""

import datetime
import json
import os
import platform
import re
import subprocess
import sys

PACKAGES = ["libtbb-dev", "libjemalloc-dev", "libopenvdb-dev", "libnanovdb-dev", "libbenchmark-dev"]
# Fields of a result that are not counters of the benchmark itself.
FIELDS = {
    "name", "family_index", "per_family_instance_index", "run_name", "run_type", "repetitions",
    "repetition_index", "threads", "iterations", "real_time", "cpu_time", "time_unit", "label",
    "items_per_second", "bytes_per_second", "aggregate_name", "aggregate_unit", "error_occurred",
    "error_message", "big_o", "rms",
}
TO_NS = {"ns": 1, "us": 1e3, "ms": 1e6, "s": 1e9}


def output(*command):
    try:
        return subprocess.run(command, capture_output=True, text=True, check=True).stdout.strip()
    except (OSError, subprocess.CalledProcessError):
        return ""


def first_match(path, pattern):
    try:
        with open(path, encoding="utf-8") as file:
            for line in file:
                match = re.match(pattern, line)
                if match:
                    return match.group(1).strip()
    except OSError:
        pass
    return "unknown"


def date_and_commit():
    stamp = os.environ.get("SOURCE_DATE_EPOCH")
    now = datetime.datetime.fromtimestamp(
        int(stamp), datetime.timezone.utc) if stamp else datetime.datetime.now(datetime.timezone.utc)
    return f"{now:%Y-%m-%d}, commit {output('git', 'rev-parse', '--short=12', 'HEAD') or 'unknown'}"


def cache(build, name):
    return first_match(os.path.join(build, "CMakeCache.txt"), re.escape(name) + r":[^=]*=(.*)")


def time(nanoseconds):
    for unit, scale in (("s", 1e9), ("ms", 1e6), ("us", 1e3)):
        if nanoseconds >= scale:
            return f"{nanoseconds / scale:.3g} {unit}"
    return f"{nanoseconds:.3g} ns"


def cell(text):
    return str(text).replace("|", "\\|").replace("\n", " ")


def description(binary):
    """The comment that a benchmark's source begins with, as it is laid out there."""
    lines = []
    try:
        with open(os.path.join("bench", binary + ".cpp"), encoding="utf-8") as file:
            for line in file:
                if not line.startswith("//"):
                    break
                lines.append(line[3:].rstrip())
    except OSError:
        pass
    return "\n".join(lines)


def main():
    build, paths = sys.argv[1], sys.argv[2:]
    rows = []
    context = {}
    for path in paths:
        with open(path, encoding="utf-8") as file:
            result = json.load(file)
        context = result["context"]
        binary = os.path.basename(path)[: -len(".json")]
        for run in result["benchmarks"]:
            if run.get("error_occurred"):
                rows.append((binary, run["name"], "error", "", "", "", run.get("error_message", "")))
                continue
            if "real_time" not in run:
                continue
            scale = TO_NS[run["time_unit"]]
            items, size = run.get("items_per_second"), run.get("bytes_per_second")
            extra = [run["label"]] if run.get("label") else []
            extra += [f"{k}={v:.4g}" for k, v in run.items() if k not in FIELDS and isinstance(v, (int, float))]
            rows.append((
                binary, run["name"], time(run["real_time"] * scale), time(run["cpu_time"] * scale),
                f"{1e9 / items:.3g}" if items else "", f"{size / 1e9:.3g}" if size else "", ", ".join(extra)))
    if not rows:
        print("bench: the benchmarks gave no result", file=sys.stderr)
        return 1

    build_type = cache(build, "CMAKE_BUILD_TYPE")
    rules = os.path.join(build, "compile_commands.json")
    with open(rules, encoding="utf-8") as file:
        command = json.load(file)[0]["command"]
    flags = " ".join(re.findall(r" (-(?:O\w*|std=\S+|f(?!debug)\S+|DNDEBUG|m\S+))(?= )", command))
    compiler = output(cache(build, "CMAKE_CXX_COMPILER"), "--version").split("\n")[0]
    versions = ", ".join(
        f"{p} {output('dpkg-query', '-W', '-f=${Version}', p) or 'unknown'}" for p in PACKAGES)
    memory = int(first_match("/proc/meminfo", r"MemTotal:\s*(\d+)").replace("unknown", "0")) / 2**20

    print("# Benchmarks\n\nWritten by `scripts/bench.sh`; do not edit.\n")
    print(f"- date: {date_and_commit()}")
    processor = first_match("/proc/cpuinfo", r"model name\s*:\s*(.*)")
    print(f"- machine: {processor}, "
          f"{context.get('num_cpus', '?')} cores, {memory:.0f} GiB, {platform.system()} {platform.release()}")
    print(f"- compiler: {compiler}, {build_type}: `{flags}`")
    print(f"- versions: {versions}")
    print(f"- allocator: {cache(build, 'VLN_ALLOCATOR')}, load at the start: {context.get('load_avg', '?')}\n")
    print("<!-- The short table, by bench.sh --quick -->\n<!-- The end of the short table -->\n")
    print("Where a benchmark says what its items are, the fourth column is the time for one of them.\n")
    binary = None
    for row in rows:
        if row[0] != binary:
            binary = row[0]
            print(f"\n## {binary}\n")
            if text := description(binary):
                print(f"```text\n{text}\n```\n")
            print("| benchmark | time | cpu | ns per item | GB/s | counters |")
            print("|---|---:|---:|---:|---:|---|")
        print("| " + " | ".join(cell(c) for c in row[1:]) + " |")
    return 0


if __name__ == "__main__":
    sys.exit(main())
