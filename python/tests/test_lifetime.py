"""Views, threads and signals: nothing moves under an array, and nothing waits for ever."""

import gc
import os
import signal
import subprocess
import sys
import threading
import time
import weakref

import numpy as np
import pytest

import vln


def volume_of(seed=0, n=24):
    rng = np.random.default_rng(seed)
    return vln.Volume.from_numpy(rng.random((n, n, n), np.float32) + 1)


def changes(volume):
    channel = volume["density"]
    return [
        lambda: channel.set((0, 0, 0), 1),
        lambda: volume.refine((0, 0, 0), (100, 100, 100)),
        lambda: volume.refine((0, 0, 0), (64, 64, 64), where=lambda c, w: np.ones(len(c), bool)),
        lambda: volume.remove(np.ones(len(volume.origins()), bool)),
        lambda: volume.add("other"),
        lambda: volume.set_coarse_values(),
        lambda: volume.fill_halos(),
        lambda: volume.__delitem__("density"),
        lambda: channel.writable().__enter__(),
    ]


def test_requirement_no_change_while_a_view_lives():
    volume = volume_of()
    view = volume["density"].values()
    before = view.copy()
    for change in changes(volume):
        with pytest.raises(BufferError, match="1 array shows"):
            change()
    part = view[3:5, ::7]
    del view
    gc.collect()
    with pytest.raises(BufferError):
        volume.refine((0, 0, 0), (100, 100, 100))
    assert np.array_equal(part, before[3:5, ::7])
    del part
    gc.collect()
    volume.refine((0, 0, 0), (100, 100, 100))
    volume["density"].set((0, 0, 0), 1)


def test_regression_a_view_of_one_channel_leaves_the_others_free():
    volume = volume_of()
    volume.add("other")
    rng = np.random.default_rng(3)
    volume["other"].set(rng.integers(0, 24, (500, 3)), 2.0)
    volume["density"].set(rng.integers(0, 24, (500, 3)), 3.0)
    first = volume["density"].values()
    before = first.copy()
    second = volume["other"].values()  # moved into one block, under the first view
    np.testing.assert_array_equal(first, before)
    assert (second == 2).any()
    with pytest.raises(BufferError):
        volume.refine((0, 0, 0), (100, 100, 100))
    del first
    with pytest.raises(BufferError):
        volume.refine((0, 0, 0), (100, 100, 100))
    del second
    gc.collect()
    volume.refine((0, 0, 0), (100, 100, 100))


def test_requirement_views_outlive_their_volume():
    volume = volume_of()
    channel = volume["density"]
    view = channel.values()
    expected = view.copy()
    coarse = channel.values(vln.FINEST - 1)
    del volume, channel
    gc.collect()
    churn = [volume_of(seed) for seed in range(3)]
    assert np.array_equal(view, expected) and not coarse.any()
    del churn


def test_requirement_views_cannot_be_written_and_writable_ones_only_inside_their_block():
    volume = volume_of()
    channel = volume["density"]
    with pytest.raises(ValueError):
        channel.values()[0, 0] = 1
    with pytest.raises(ValueError):
        channel.values().flags.writeable = True
    gc.collect()
    with channel.writable() as w:
        values = w.values()
        values *= 2
        assert len(w.origins()) == len(values)
        with pytest.raises(BufferError):
            channel.set((0, 0, 0), 1)
    with pytest.raises(ValueError):
        values[0, 0] = 5
    with pytest.raises(ValueError, match="inside the with"):
        w.values()
    corner = channel.origins()[0]
    assert channel.get(corner) == values[0, 0] >= 2
    assert channel.sample(corner) == values[0, 0]
    del values, w
    gc.collect()
    channel.set((0, 0, 0), 1)


def test_requirement_packing_keeps_every_value(bunny):
    channel = bunny["ls_bunny"]
    before = channel.to_numpy()
    values, origins = channel.values(), channel.origins()
    low = np.array(channel.box[0])
    inside = ((origins >= low) & (origins + 4 <= channel.box[1])).all(axis=1)
    for corner, block in zip(origins[inside][::50], values[inside][::50]):
        i, j, k = corner - low
        assert np.array_equal(before[i : i + 4, j : j + 4, k : k + 4], block.reshape(4, 4, 4).T)
    assert channel.values().ctypes.data == values.ctypes.data  # the second call copies nothing
    del values
    channel.set((300, 300, 300), 1)  # the channel's tiles lie apart again
    again = channel.values()
    assert np.array_equal(channel.to_numpy(box=((-80, 25, -53), (54, 157, 52))), before)
    assert len(again) == len(channel.origins())


def test_requirement_a_volume_is_freed_with_its_last_user():
    volume = volume_of()
    core = weakref.ref(volume._core)
    view = volume["density"].values()
    del volume
    gc.collect()
    assert core() is None and view.sum() > 0


def test_requirement_threads_read_at_once_and_wait_for_changes():
    volume = volume_of(n=32)
    channel = volume["density"]
    xyz = np.random.default_rng(1).uniform(0, 31, (20000, 3))
    expected = channel.sample(xyz)
    errors = []

    def read():
        try:
            for _ in range(20):
                assert np.array_equal(channel.sample(xyz), expected)
                assert channel.to_numpy(box=((0, 0, 0), (8, 8, 8))).min() >= 1
                channel.active_count
        except BaseException as error:
            errors.append(error)

    def change(seed):
        rng = np.random.default_rng(seed)
        try:
            for _ in range(20):
                channel.set(rng.integers(100, 400, (50, 3)), 7)
                volume.refine((100, 0, 0), (120, 20, 20))
        except BaseException as error:
            errors.append(error)

    def show():
        try:
            for _ in range(40):
                try:
                    view = channel.values()
                    assert (view.sum(axis=1) >= 0).all()
                    del view
                except BufferError:
                    pass
        except BaseException as error:
            errors.append(error)

    def change_unless_shown(seed):
        try:
            for _ in range(40):
                try:
                    channel.set((1000 + seed, 0, 0), 1)
                except BufferError:
                    pass
        except BaseException as error:
            errors.append(error)

    for work in ([read, read, lambda: change(1), lambda: change(2)],
                 [show, show, lambda: change_unless_shown(1), read]):
        threads = [threading.Thread(target=w) for w in work]
        for thread in threads:
            thread.start()
        for thread in threads:
            thread.join(120)
            assert not thread.is_alive()
    assert not errors, errors[:1]


def test_requirement_files_are_read_by_threads(data):
    found = []

    def read():
        found.append(vln.open(data / "vdb" / "sphereCd.vdb")["Cd"].active_count)

    threads = [threading.Thread(target=read) for _ in range(4)]
    for thread in threads:
        thread.start()
    for thread in threads:
        thread.join(120)
    assert found == [9047] * 4


def test_negative_a_callback_that_comes_back_is_told_and_does_not_hang(data, tmp_path):
    def reads(stage, share):
        vln.open(data / "vdb" / "sphereCd.vdb")

    with pytest.raises(RuntimeError, match="comes out of"):
        vln.open(data / "vdb" / "sphereCd.vdb", progress=reads)
    volume = volume_of()
    seen = []

    def where(corners, width):
        seen.append(volume["density"].active_count)
        volume["density"].set((0, 0, 0), 2)
        return np.ones(len(corners), bool)

    volume.refine((0, 0, 0), (32, 32, 32), where=where)
    assert seen


def test_requirement_other_threads_run_while_a_long_call_does(data):
    ticks = []
    done = threading.Event()

    def tick():
        while not done.is_set():
            ticks.append(time.monotonic())
            time.sleep(0.005)

    thread = threading.Thread(target=tick)
    thread.start()
    begin = time.monotonic()
    vln.open(data / "vdb" / "bunny_ls_512_half.vdb")
    took = time.monotonic() - begin
    done.set()
    thread.join()
    if took > 0.2:
        assert len([t for t in ticks if t < begin + took]) > 5


LONG = """
import numpy as np, signal, sys, threading, time, vln
# A process that is started in the background ignores the signal, and so do its children.
signal.signal(signal.SIGINT, signal.default_int_handler)
volume = vln.Volume.from_numpy(np.random.default_rng(0).random((64, 64, 64), np.float32))
channel = volume["density"]
xyz = np.random.default_rng(1).uniform(-100, 100, (60_000_000, 3))
print("ready", flush=True)
begin = time.monotonic()
try:
    channel.sample(xyz)
    print("finished", time.monotonic() - begin)
except KeyboardInterrupt:
    print("stopped", time.monotonic() - begin)
    channel.set((0, 0, 0), 1)
"""


def test_requirement_ctrl_c_stops_a_long_call():
    process = subprocess.Popen([sys.executable, "-c", LONG], stdout=subprocess.PIPE, text=True, env=dict(os.environ))
    assert process.stdout.readline().strip() == "ready"
    time.sleep(0.3)
    process.send_signal(signal.SIGINT)
    out, _ = process.communicate(timeout=120)
    assert out.startswith("stopped"), out
    assert process.returncode == 0
