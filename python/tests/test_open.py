"""Opening real files: values and active voxels as in the file."""

import numpy as np
import pytest

import vln


def test_requirement_a_file_is_a_mapping_of_names_to_channels(bunny):
    assert len(bunny) == 1 and list(bunny) == ["ls_bunny"] and "ls_bunny" in bunny
    channel = bunny["ls_bunny"]
    assert channel.type == "float" and channel.dtype == np.float32
    assert channel.box == ((-80, 25, -53), (54, 157, 52))
    assert channel.active_count == 235046
    with pytest.raises(KeyError, match="has no grid 'x'"):
        bunny["x"]


def test_requirement_dense_values_and_samples_agree(bunny):
    channel = bunny["ls_bunny"]
    dense = channel.to_numpy()
    assert dense.shape == (134, 132, 105) and dense.dtype == np.float32
    rng = np.random.default_rng(1)
    low = np.array(channel.box[0])
    ijk = low + rng.integers(0, dense.shape, (1000, 3))
    expected = dense[tuple((ijk - low).T)]
    assert np.array_equal(channel.get(ijk), expected)
    assert np.array_equal(channel.sample(ijk, space="index"), expected)
    world = bunny.volume.to_world(ijk)
    assert np.allclose(channel.sample(world), expected, atol=1e-9)


def test_requirement_every_grid_of_every_file_reads_as_the_peer_reads_it(data):
    peer = pytest.importorskip("pyopenvdb")
    compared = 0
    for path in sorted((data / "vdb").glob("*.vdb")):
        if path.stat().st_size > 5_000_000:
            continue
        with vln.open(path) as file:
            for name in file:
                try:
                    grid = peer.read(str(path), name)
                except TypeError:
                    continue  # grids of integers are none of the peer's
                channel = file[name]
                assert channel.active_count == grid.activeVoxelCount(), (path, name)
                if channel.box is None:
                    continue
                dense = channel.to_numpy()
                expected = np.empty(dense.shape, dtype=dense.dtype)
                grid.copyToArray(expected, ijk=channel.box[0])
                assert np.array_equal(dense, expected), (path, name)
                active = channel.active()
                assert len(np.unique(active, axis=0)) == grid.activeVoxelCount()
                accessor = grid.getConstAccessor()
                for ijk in active[:: max(1, len(active) // 50)]:
                    assert accessor.isValueOn(tuple(int(v) for v in ijk))
                compared += 1
    assert compared > 15


def test_requirement_a_box_reads_beyond_what_is_there(bunny):
    channel = bunny["ls_bunny"]
    dense = channel.to_numpy()
    low, high = channel.box
    wide = channel.to_numpy(box=([a - 5 for a in low], [b + 3 for b in high]))
    assert np.array_equal(wide[5:-3, 5:-3, 5:-3], dense)
    assert (wide[:5] == channel.background).all()
    inner = channel.to_numpy(box=((0, 40, 0), (1, 42, 3)))
    assert inner.shape == (1, 2, 3)
    assert inner[0, 1, 2] == channel.get([0, 41, 2])


def test_requirement_coarse_depths_have_samples_twice_as_wide(bunny):
    channel = bunny["ls_bunny"]
    low, high = channel.box
    for depth in (27, 26, 24):
        width = 1 << (vln.FINEST - depth)
        dense = channel.to_numpy(depth=depth)
        first = [a // width for a in low]
        assert dense.shape == tuple(-(-b // width) - f for b, f in zip(high, first))
        corners = np.argwhere(np.ones(dense.shape, bool))[:: 997]
        at = (corners + first) * width
        # Importers give every coarse sample the grid's value at its corner.
        assert np.array_equal(dense[tuple(corners.T)], channel.get(at))


def test_requirement_gradients_are_those_of_world_space(data):
    channel = vln.open(data / "vdb" / "sphere.vdb")["ls_sphere"]
    rng = np.random.default_rng(2)
    normals = rng.normal(size=(500, 3))
    normals /= np.linalg.norm(normals, axis=1)[:, None]
    values, gradients = channel.sample(3 * normals, gradient=True)
    assert np.abs(values).max() < 0.01
    assert np.abs(gradients - normals).max() < 0.05


def test_requirement_a_single_position_gives_a_single_value(bunny):
    channel = bunny["ls_bunny"]
    value = channel.sample(bunny.volume.to_world((0, 40, 0)))
    assert value.shape == () and value == channel.get((0, 40, 0))
    value, gradient = channel.sample((0, 40, 0), gradient=True, space="index")
    assert value.shape == () and gradient.shape == (3,)


def test_requirement_points_come_with_their_positions(data):
    file = vln.open(data / "vdb" / "sphere_points.vdb")
    points = file.points[0]
    assert len(file) == 0 and len(points) == 9802
    radius = np.linalg.norm(points.positions, axis=1)
    assert radius.min() > 0.5 and radius.max() < 1.2


def test_requirement_a_closed_file_lets_go_and_what_was_taken_stays(data):
    with vln.open(data / "vdb" / "bunny_ls_128.vdb") as file:
        channel = file["ls_bunny"]
        values = channel.values()
    assert file.closed
    with pytest.raises(ValueError, match="closed"):
        file.names
    assert channel.get((0, 40, 0)) and values.sum() != 0


def test_requirement_progress_is_told_and_may_end_the_call(data):
    told = []
    vln.open(data / "vdb" / "smoke.vdb", progress=lambda stage, share: told.append((stage, share)))
    assert told[0][1] == 0 and told[-1][1] == 1
    assert all(a[1] <= b[1] for a, b in zip(told, told[1:]))

    class Enough(Exception):
        pass

    def stop(stage, share):
        if share > 0.3:
            raise Enough

    with pytest.raises(Enough):
        vln.open(data / "vdb" / "smoke.vdb", progress=stop)
    reading = []

    def stop_reading(stage, share):
        reading.append((stage, share))
        if stage == "reading" and share > 0:
            raise Enough

    with pytest.raises(Enough):
        vln.open(data / "vdb" / "bunny_ls_512_half.vdb", progress=stop_reading)
    assert reading[-1][0] == "reading" and len(reading) == 2
    vln.open(data / "vdb" / "sphereCd.vdb")  # nothing stays locked


def test_requirement_a_filter_chooses_grids(data):
    path = data / "vdb" / "mantaflow_smoke_0010.vdb"
    assert sorted(vln.open(path, channels="density*").names) == ["density", "density_inflow"]


def test_requirement_info_and_repr_say_what_there_is(bunny):
    info = bunny.info()
    assert info["volumes"][0]["channels"]["ls_bunny"]["active"] == 235046
    assert "levels" in repr(bunny.volume) and "bytes" in repr(bunny.volume)
    assert "235046 active voxels" in repr(bunny["ls_bunny"])
    assert "ls_bunny" in repr(bunny)


def test_requirement_notebooks_get_pictures_and_tables(bunny):
    channel = bunny["ls_bunny"]
    png = channel._repr_png_()
    assert png.startswith(b"\x89PNG\r\n\x1a\n") and len(png) > 1000
    assert channel.png("x", size=64) != channel.png("y", size=64)
    assert channel.png(gradient=True) != channel.png()
    assert "235046" in channel._repr_html_() and "data:image/png" in channel._repr_html_()
    assert "ls_bunny" in bunny.volume._repr_html_()
    empty = vln.Volume().add("<b>")
    assert empty._repr_png_() is None and "&lt;b&gt;" in empty._repr_html_()
    with pytest.raises(ValueError, match="axis"):
        channel.png("w")
    with pytest.raises(ValueError):
        channel.png(at=1e9)
