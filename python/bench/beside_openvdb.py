"""Measures the module beside OpenVDB's own, in one run on the same files, and prints a table.

    PYTHONPATH=build/python/python /usr/bin/python3 python/bench/beside_openvdb.py FILE.vdb...

Each figure is the median of several runs, one of each side in turn. Where OpenVDB's module has no such call the other
side is what its users write instead, as the table says.
"""

import statistics
import sys
import time

import numpy as np
import pyopenvdb
import scipy.ndimage

import vln

RUNS = 7


def measure(ours, theirs, runs=RUNS):
    """Medians in seconds; first one run of each that does not count."""
    sides = (ours, theirs)
    times = ([], [])
    for run in range(runs + 1):
        for side, into in zip(sides, times):
            begin = time.perf_counter()
            side()
            if run:
                into.append(time.perf_counter() - begin)
    return statistics.median(times[0]), statistics.median(times[1])


def rows_for(path):
    ours = vln.open(path)
    # Numbers of one component are compared: OpenVDB's module has no dense vectors beside them in scipy.
    name = next((n for n in ours.names if ours[n].dtype == np.float32 and np.ndim(ours[n].background) == 0), None)
    if name is None:
        print(f"beside_openvdb.py: {path} holds no grid of floats, and is left out", file=sys.stderr)
        return
    theirs = pyopenvdb.read(path, name)
    channel = ours[name]
    low, high = channel.box
    dense = channel.to_numpy()
    flat = np.ascontiguousarray(dense)
    background = float(channel.background)

    def dense_of(grid):
        out = np.empty(dense.shape, dense.dtype)
        grid.copyToArray(out, ijk=low)
        return out

    # OpenVDB's reader leaves the values on the disk until they are asked for.
    row = "a file as a dense array"
    yield row, "`read`, `copyToArray`", *measure(
        lambda: vln.open(path)[name].to_numpy(box=(low, high)), lambda: dense_of(pyopenvdb.read(path, name)))

    assert np.array_equal(dense_of(theirs), dense)
    yield "dense out", "`copyToArray`", *measure(lambda: channel.to_numpy(box=(low, high)), lambda: dense_of(theirs))

    def dense_theirs():
        grid = pyopenvdb.FloatGrid(background)
        grid.copyFromArray(flat, ijk=low)
        return grid

    def dense_ours():
        return vln.Volume.from_numpy(flat, background=background, low=low)

    yield "dense in", "`copyFromArray`", *measure(dense_ours, dense_theirs)

    rng = np.random.default_rng(0)
    index = rng.uniform(low, np.array(high) - 1.001, (1_000_000, 3))
    world = ours.volume.to_world(index)
    place = (index - low).T

    def sample_theirs():
        return scipy.ndimage.map_coordinates(flat, place, order=1, output=np.float32)

    assert np.abs(channel.sample(world) - sample_theirs()).max() < 1e-4 * np.ptp(dense)
    row = "a million samples, anywhere"
    yield row, "none; scipy's `map_coordinates` on the dense array", *measure(lambda: channel.sample(world), sample_theirs)

    ijk = channel.active()[: 100_000]
    as_tuples = [tuple(int(v) for v in p) for p in ijk]

    def get_theirs():
        accessor = theirs.getConstAccessor()
        return [accessor.getValue(p) for p in as_tuples]

    assert np.array_equal(np.float32(get_theirs()), channel.get(ijk))
    yield "100 000 values by index", "a loop with an accessor", *measure(lambda: channel.get(ijk), get_theirs)

    def active_theirs():
        return sum(item.value for item in theirs.citerOnValues())

    yield "sum of the active values", "a loop over `citerOnValues`", *measure(
        lambda: channel.get(channel.active()).sum(dtype=float), active_theirs, 3)

    def change_ours():
        with channel.writable() as w:
            values = w.values()
            np.negative(values, out=values)

    yield "negate all values in place", "`mapAll`", *measure(change_ours, lambda: theirs.mapAll(lambda v: -v), 3)


def main(paths):
    print("| file | work | OpenVDB's module | vln, ms | other, ms | ratio |")
    print("|---|---|---|---|---|---|")
    for path in paths:
        for work, how, ours, theirs in rows_for(path):
            print(f"| {path.rsplit('/', 1)[-1]} | {work} | {how} | {ours * 1e3:.2f} | {theirs * 1e3:.2f} | {theirs / ours:.2f} |",
                  flush=True)


if __name__ == "__main__":
    if len(sys.argv) < 2:
        sys.exit("usage: beside_openvdb.py FILE.vdb...")
    main(sys.argv[1:])
