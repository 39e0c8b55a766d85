"""Volumes made of arrays, of every element type, strides and order; values set; files written and read."""

import numpy as np
import pytest

import vln

TYPES = [
    (np.float32, ()), (np.float64, ()), (np.int32, ()), (np.int64, ()), (bool, ()), (np.uint8, ()),
    (np.float32, (3,)), (np.float64, (3,)), (np.int32, (3,)),
    (np.int8, ()), (np.int16, ()), (np.uint16, ()), (np.uint32, ()), (np.uint64, ()),
    (np.float32, (2,)), (np.float32, (4,)), (np.float32, (3, 3)), (np.float32, (4, 4)),
]
# A build may have fewer.
TYPES = [
    t for t in TYPES
    if (np.dtype(np.uint8 if t[0] is bool else t[0]), t[1]) in vln._checks.ELEMENT_TYPES.values()
]


def example(dtype, inner, shape=(9, 14, 6), seed=3):
    rng = np.random.default_rng(seed)
    array = rng.integers(0, 100, shape + inner)
    array[rng.random(shape) < 0.7] = 0
    return (array % 2 if dtype is bool else array).astype(dtype)


@pytest.mark.parametrize("dtype, inner", TYPES)
def test_requirement_each_type_goes_in_and_out(dtype, inner):
    array = example(dtype, inner)
    volume = vln.Volume.from_numpy(array, voxel_size=0.5, low=(-3, 5, 100), name="v")
    channel = volume["v"]
    assert channel.dtype == np.dtype(dtype) and channel.element_shape == inner
    box = ((-3, 5, 100), (6, 19, 106))
    back = channel.to_numpy(box=box)
    assert back.dtype == array.dtype and np.array_equal(back, array)
    filled = (array != 0).reshape(array.shape[:3] + (-1,)).any(axis=-1)
    assert channel.active_count == filled.sum()
    active = channel.active()
    assert np.array_equal(channel.get(active), array[tuple((active - box[0]).T)])
    for depth in (vln.FINEST, vln.FINEST - 1):
        assert channel.values(depth).shape[1:] == (64,) + inner
        assert len(channel.values(depth)) == len(channel.origins(depth))
    channel_values = channel.values()
    for corner, block in list(zip(channel.origins(), channel_values))[:5]:
        cube = channel.to_numpy(box=(corner, corner + 4))
        assert np.array_equal(block.reshape(4, 4, 4, *inner).swapaxes(0, 2), cube)


OF_FILES = [t for t in TYPES if t[1] in ((), (3,)) and t[0] in (np.float32, np.float64, np.int32, np.int64, bool)]


@pytest.mark.parametrize("dtype, inner", OF_FILES)
def test_requirement_each_type_of_files_is_written_and_read(tmp_path, dtype, inner):
    array = example(dtype, inner)
    volume = vln.Volume.from_numpy(array, voxel_size=0.25, origin=(1, 2, 3), name="v")
    volume.save(tmp_path / "a.vdb")
    file = vln.open(tmp_path / "a.vdb")
    channel = file["v"]
    assert channel.type == volume["v"].type
    assert np.array_equal(channel.to_numpy(box=((0, 0, 0), array.shape[:3])), array)
    assert channel.active_count == volume["v"].active_count
    assert np.allclose(file.volume.to_world((1, 1, 1)), (1.25, 2.25, 3.25))


@pytest.mark.parametrize(
    "view",
    [
        lambda a: np.asfortranarray(a),
        lambda a: np.ascontiguousarray(a[::-1, :, ::-2])[::-1, :, ::-1],
        lambda a: a[::-1, :, ::2],
        lambda a: a.transpose(2, 0, 1),
        lambda a: np.broadcast_to(a[:, :1, :], a.shape),
        lambda a: a.astype(">f4"),
        lambda a: np.lib.stride_tricks.as_strided(a, (5, 5, 5), (4, 4, 4)),
    ],
)
def test_requirement_strides_and_byte_orders_are_honoured(view):
    array = view(example(np.float32, ()))
    volume = vln.Volume.from_numpy(array)
    back = volume["density"].to_numpy(box=((0, 0, 0), array.shape))
    assert np.array_equal(back, array)


def test_requirement_components_may_have_any_strides():
    array = example(np.float32, (6,))[..., ::-2]
    volume = vln.Volume.from_numpy(array)
    assert np.array_equal(volume["density"].to_numpy(box=((0, 0, 0), array.shape[:3])), array)


def test_requirement_values_near_the_background_become_it():
    array = np.zeros((8, 8, 8), np.float32) + 1
    array[0, 0, 0], array[7, 7, 7] = 1.4, 2
    volume = vln.Volume.from_numpy(array, background=1, tolerance=0.5)
    assert volume.tiles_by_depth[vln.FINEST] == 1 and volume["density"].active_count == 1
    assert volume["density"].get((0, 0, 0)) == 1 and volume["density"].get((7, 7, 7)) == 2


def test_requirement_halves_become_floats():
    array = example(np.float16, ())
    assert np.array_equal(vln.Volume.from_numpy(array)["density"].to_numpy(box=((0, 0, 0), array.shape)), array)


def test_boundary_empty_arrays_make_empty_volumes():
    volume = vln.Volume.from_numpy(np.zeros((0, 3, 4), np.float32))
    channel = volume["density"]
    assert volume.tile_count == 0 and channel.box is None and channel.to_numpy().shape == (0, 0, 0)
    assert channel.values().shape == (0, 64) and channel.active().shape == (0, 3)
    assert channel.sample(np.zeros((0, 3))).shape == (0,) and channel.sample((1, 2, 3)) == 0
    assert vln.Volume.from_numpy(np.zeros((5, 5, 5)))["density"].active_count == 0


def test_requirement_the_last_of_equal_indices_counts():
    channel = vln.Volume().add("a")
    ijk = np.array([[1, 2, 3]] * 1000 + [[-5, 0, 0]])
    channel.set(ijk, np.arange(1001))
    assert channel.get((1, 2, 3)) == 999 and channel.get((-5, 0, 0)) == 1000
    channel.set([[7, 7, 7], [8, 8, 8]], 4)
    assert channel.to_numpy(box=((7, 7, 7), (9, 9, 9)))[1, 1, 1] == 4


def test_requirement_set_marks_active_where_states_are_kept(data, tmp_path):
    file = vln.open(data / "vdb" / "mantaflow_smoke_0010.vdb", channels="shadow")
    channel = file["shadow"]
    before = channel.active_count
    channel.set([(500, 0, 0), (501, 0, 0)], [3, 0])
    assert channel.active_count == before + 2
    file.volume.save(tmp_path / "a.vdb")
    assert vln.open(tmp_path / "a.vdb")["shadow"].active_count == before + 2


def test_requirement_active_voxels_that_were_rounded_to_the_background_count(data, tmp_path):
    file = vln.open(data / "vdb" / "bunny_ls_512_half.vdb")
    channel = file["ls_bunny"]
    active = channel.active()
    values = channel.get(active)
    assert channel.active_count == len(active) == len(np.unique(active, axis=0)) == 3_778_680
    assert np.count_nonzero(np.abs(values) == channel.background) == 989
    low, high = channel.box
    assert np.array_equal(active.min(axis=0), low) and np.array_equal(active.max(axis=0) + 1, high)
    assert list(file) == ["ls_bunny"]
    file.volume.save(tmp_path / "a.vdb")
    assert vln.open(tmp_path / "a.vdb")["ls_bunny"].active_count == 3_778_680


def test_requirement_blends_of_each_type_match_a_slow_model():
    rng = np.random.default_rng(5)
    for dtype, inner in [(np.float32, ()), (np.float64, ()), (np.float32, (3,)), (np.float64, (3,))]:
        array = rng.normal(size=(12, 12, 12) + inner).astype(dtype)
        channel = vln.Volume.from_numpy(array)["density"]
        p = rng.uniform(0, 10.9, (300, 3))
        low = np.floor(p).astype(int)
        t = p - low
        expected = np.zeros((300,) + inner)
        for corner in np.ndindex(2, 2, 2):
            share = np.prod(np.where(corner, t, 1 - t), axis=1).reshape((-1,) + (1,) * len(inner))
            expected += share * array[tuple((low + corner).T)]
        assert np.abs(channel.sample(p) - expected).max() < (3e-6 if dtype is np.float32 else 1e-13)


def test_requirement_integers_and_bools_are_those_of_the_nearest_sample():
    array = example(np.int32, ())
    channel = vln.Volume.from_numpy(array)["density"]
    p = np.random.default_rng(6).uniform(0, 4, (100, 3))
    assert np.array_equal(channel.sample(p), array[tuple(np.floor(p + 0.5).astype(int).T)])
    flags = vln.Volume.from_numpy(array > 50)["density"]
    assert flags.sample(p).dtype == bool
    assert np.array_equal(flags.sample(p), (array > 50)[tuple(np.floor(p + 0.5).astype(int).T)])


def test_requirement_far_from_the_origin_blends_keep_their_precision():
    array = np.arange(64, dtype=np.float32).reshape(4, 4, 4)
    channel = vln.Volume.from_numpy(array, low=(10_000_000, 0, -8_000_000))["density"]
    p = np.array([1.375, 1.0, 1.0])
    value = channel.sample(p + (10_000_000, 0, -8_000_000), space="index")
    assert value == array[1, 1, 1] + 0.375 * 16


def test_requirement_refining_changes_no_value_and_removing_uncovers():
    array = np.ones((16, 16, 16), np.float32)
    volume = vln.Volume.from_numpy(array)
    channel = volume["density"]
    volume.set_coarse_values()
    calls = []

    def where(corners, width):
        calls.append(width)
        return (corners < 8).all(axis=1)

    removed = volume.remove(where)
    assert removed == 8 and calls == [4]
    assert np.array_equal(channel.to_numpy(box=((0, 0, 0), array.shape)), array)
    count = volume.tile_count
    volume.refine((0, 0, 0), (8, 8, 8), where=lambda corners, width: np.ones(len(corners), bool))
    assert volume.tile_count == count + 8
    assert np.array_equal(channel.to_numpy(box=((0, 0, 0), array.shape)), array)
    volume.remove(np.ones(len(volume.origins()), bool))
    assert vln.FINEST not in volume.tiles_by_depth
    volume.refine((-1, -1, -1), (1, 1, 1))
    assert volume.tiles_by_depth[vln.FINEST] == 8


def test_requirement_points_are_written_and_read(tmp_path):
    rng = np.random.default_rng(7)
    xyz = rng.normal(size=(500, 3)) * 10 + 1000
    points = vln.Volume.from_points(xyz, 0.5, {"mass": np.arange(500.0), "v": xyz.astype(np.float32)}, name="p")
    points.save(tmp_path / "a.ply")
    points.save(tmp_path / "a.vdb")
    back = vln.open(tmp_path / "a.vdb").points[0]
    assert back.name == "p" and len(back) == 500 and sorted(back.attributes) == ["mass", "v"]
    order, expected = np.argsort(back["mass"]), xyz
    assert np.abs(back.positions[order] - expected).max() < 1e-4
    assert np.array_equal(back["v"][order], xyz.astype(np.float32))


def test_requirement_a_volume_with_points_is_saved_whole(data, tmp_path):
    file = vln.open(data / "vdb" / "sphere_points.vdb")
    file.save(tmp_path / "a.vdb")
    assert len(vln.open(tmp_path / "a.vdb").points[0]) == 9802


def test_requirement_flat_buffers_are_given_on_without_a_copy(bunny, tmp_path):
    flat = bunny.volume.flatten()
    array = np.asarray(flat)
    assert array.dtype == np.uint8 and array.nbytes == flat.nbytes and not array.flags.writeable
    address = array.__array_interface__["data"][0]
    assert flat.to_numpy().__array_interface__["data"][0] == address
    assert np.from_dlpack(flat).__array_interface__["data"][0] == address
    assert len(bytes(flat)) == flat.nbytes
    flat.save(tmp_path / "a.nvtt")
    back = vln.open(tmp_path / "a.nvtt")
    channel = bunny["ls_bunny"]
    assert np.array_equal(back["ls_bunny"].to_numpy(box=channel.box), channel.to_numpy())
    keep = np.asarray(flat)
    first = keep[:16].copy()
    del flat, array
    assert np.array_equal(keep[:16], first)
    capsule = bunny.volume.flatten().__dlpack__()
    del capsule  # never taken: freed by itself


def test_requirement_a_channel_can_be_added_and_removed(bunny, tmp_path):
    volume = bunny.volume
    inside = volume.add("inside", dtype=bool)
    sdf = volume["ls_bunny"]
    inside.set(sdf.active(), sdf.get(sdf.active()) < 0)
    assert sorted(volume.names) == ["inside", "ls_bunny"]
    volume.save(tmp_path / "a.vdb")
    back = vln.open(tmp_path / "a.vdb")
    assert back["inside"].type == "bool" and back["inside"].active_count == inside.active_count > 0
    del volume["inside"]
    assert volume.names == ["ls_bunny"]
    with pytest.raises(ValueError, match="no channel"):
        inside.get((0, 0, 0))


def test_requirement_a_flat_buffer_has_the_buffer_protocol(bunny, tmp_path):
    flat = bunny.volume.flatten(quantisation="fp8")
    view = memoryview(flat)
    assert view.readonly and view.nbytes == flat.nbytes == len(flat)
    (tmp_path / "raw").write_bytes(flat)
    assert (tmp_path / "raw").stat().st_size == flat.nbytes
    with pytest.raises(TypeError):
        view[0] = 1


def test_requirement_coarse_samples_are_blended_where_there_are_no_finer_ones():
    volume = vln.Volume.from_numpy(np.random.default_rng(8).random((16, 16, 16), np.float32))
    channel = volume["density"]
    volume.set_coarse_values()
    volume.remove(np.ones(len(volume.origins()), bool))
    coarse = channel.to_numpy(box=((0, 0, 0), (16, 16, 16)), depth=vln.FINEST - 1)
    p = np.random.default_rng(9).uniform(0, 6.9, (300, 3))
    low = np.floor(p).astype(int)
    t = p - low
    expected = np.zeros(len(p))
    for corner in np.ndindex(2, 2, 2):
        expected += np.prod(np.where(corner, t, 1 - t), axis=1) * coarse[tuple((low + corner).T)]
    assert np.abs(channel.sample(2 * p, space="index") - expected).max() < 1e-5
    _, gradient = channel.sample(2 * p, gradient=True, space="index")
    step = 1e-3
    for axis in range(3):
        ahead = 2 * p
        ahead[:, axis] += step
        same_cell = (np.floor(ahead / 2) == low).all(axis=1)
        slope = (channel.sample(ahead, space="index") - channel.sample(2 * p, space="index")) / step
        assert np.abs(slope - gradient[:, axis])[same_cell].max() < 2e-2
