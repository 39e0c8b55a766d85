"""Files of arrays: what numpy and VTK write is read, and what is written is read by numpy and Zarr."""

import json
import os

import numpy as np
import pytest

import vln
from test_formats import volume_of_many


def assert_same(found, wanted):
    """All channels of two volumes, over the box of the second and a bit beyond. Archives have no slashes in names."""
    assert {name.replace("/", "_") for name in found.names} == {name.replace("/", "_") for name in wanted.names}
    for name in wanted.names:
        low, high = wanted[name].box
        box = (np.subtract(low, 3), np.add(high, 3))
        other = found[name if name in found else name.replace("/", "_")]
        assert np.array_equal(other.to_numpy(box), wanted[name].to_numpy(box)), name
        assert np.array_equal(other.background, wanted[name].background)
    ijk = np.array([(0, 0, 0), (5, -3, 9)])
    assert np.allclose(found.to_world(ijk), wanted.to_world(ijk))


@pytest.mark.parametrize("suffix", ["vdb", "nvdb", "npz", "vti"])
def test_requirement_what_is_saved_is_opened(suffix, tmp_path):
    volume, arrays = volume_of_many()
    if suffix == "nvdb":
        for name in ("x", "w"):  # vectors of integers and of doubles are not in such files
            with pytest.raises(vln.FileError, match="of a type that .nvdb files do not have"):
                volume.save(tmp_path / "a.nvdb")
            del volume[name]
        assert list(tmp_path.iterdir()) == []
    volume.save(tmp_path / f"a.{suffix}")
    with vln.open(tmp_path / f"a.{suffix}") as file:
        assert_same(file.volume, volume)
        assert np.array_equal(file["f"].to_numpy(volume["f"].box), arrays["f"])


def test_requirement_voxels_one_by_one_keep_what_is_active(tmp_path):
    volume, _ = volume_of_many()
    volume.add("zeros", background=2).set([(1, 2, 3), (1000, -5000, 70)], [0, 4])
    told = []
    volume.save(tmp_path / "a.npz", sparse=True, progress=lambda stage, share: told.append(share))
    assert told[-1] == 1
    with np.load(tmp_path / "a.npz") as content:
        order = np.lexsort(content["zeros.indices"].T[::-1])
        assert np.array_equal(content["zeros.indices"][order], [(1, 2, 3), (1000, -5000, 70)])
        assert np.array_equal(content["zeros.values"][order], [0, 4]) and content["zeros.background"] == 2
    with vln.open(tmp_path / "a.npz") as file:
        assert_same(file.volume, volume)
        for name in volume.names:
            assert file[name.replace("/", "_")].active_count == volume[name].active_count, name
    with pytest.raises(ValueError, match="sparse"):
        volume.save(tmp_path / "a.vdb", sparse=True)


@pytest.mark.parametrize("save", [np.savez, np.savez_compressed])
def test_requirement_archives_of_numpy_are_read(save, tmp_path):
    rng = np.random.default_rng(8)
    arrays = {name: rng.integers(0, 100, (6, 11, 9)).astype(kind) for name, kind in
              [("f2", "f2"), ("f4", ">f4"), ("f8", "f8"), ("i1", "i1"), ("u1", "u1"), ("i2", ">i2"), ("u2", "u2"),
               ("i4", "i4"), ("u4", ">u4"), ("i8", ">i8"), ("u8", "u8"), ("b1", "?")]}
    arrays["strided"] = rng.normal(size=(12, 11, 18)).astype("f4")[::2, :, ::2]
    arrays["fortran"] = np.asfortranarray(rng.normal(size=(6, 11, 9)))
    arrays["v"] = rng.normal(size=(6, 11, 9, 3)).astype("f4")
    left_out = {"flat": np.zeros(7), "complex": np.zeros((3, 3, 3), complex), "pairs": np.zeros((3, 3, 3, 2)),
                "text": np.array(["a", "b"])}
    save(tmp_path / "a.npz", voxel_size=(0.5, 2, 1), origin=(1, 2, 3), **arrays, **left_out)
    with vln.open(tmp_path / "a.npz") as file:
        assert set(file.names) == set(arrays)
        assert {name for name, _ in file.skipped} == set(left_out)
        for name, array in arrays.items():
            found = file[name].to_numpy(((0, 0, 0), (6, 11, 9)))
            assert np.array_equal(found, array), name
            assert found.dtype.kind == array.dtype.kind or array.dtype.kind == "u"
            different = array != 0 if array.ndim == 3 else (array != 0).any(axis=3)
            assert file[name].active_count == different.sum()
        assert np.allclose(file.volume.to_world([(2, 3, 4)]), [(2, 8, 7)])


def test_requirement_pairs_may_stand_alone(tmp_path):
    np.savez(tmp_path / "a.npz", indices=np.array([(5, -70, 2**20), (0, 0, 0)]), values=np.array([2.5, 0]))
    with vln.open(tmp_path / "a.npz") as file:
        assert file.names == ["values"] and file["values"].active_count == 2
        assert file["values"].get((5, -70, 2**20)) == 2.5


def test_negative_damaged_archives_are_errors_of_one_line(tmp_path):
    np.savez(tmp_path / "a.npz", a=np.array([{"an": "object"}] * 8, dtype=object).reshape(2, 2, 2))
    with vln.open(tmp_path / "a.npz") as file:
        assert file.names == [] and len(file.skipped) == 1
    np.savez(tmp_path / "a.npz", a=np.full((2, 2, 2), 2**64 - 1, np.uint64))
    with pytest.raises(vln.FileError, match="64 bits"):
        vln.open(tmp_path / "a.npz")
    np.savez(tmp_path / "a.npz", a=np.ones((4, 4, 4)))
    whole = (tmp_path / "a.npz").read_bytes()
    for end in range(0, len(whole), 37):
        (tmp_path / "a.npz").write_bytes(whole[:end])
        with pytest.raises(vln.FileError) as told:
            vln.open(tmp_path / "a.npz")
        assert "a.npz: " in str(told.value) and "\n" not in str(told.value)


@pytest.mark.parametrize("mode", ["Ascii", "Binary", "Appended"])
@pytest.mark.parametrize("encoded", [False, True])
@pytest.mark.parametrize("compressed", [False, True])
@pytest.mark.parametrize("wide", [False, True])
def test_requirement_images_that_vtk_writes_are_read(mode, encoded, compressed, wide, tmp_path):
    vtk_io = pytest.importorskip("vtkmodules.vtkIOXML")
    from vtkmodules.util.numpy_support import numpy_to_vtk
    from vtkmodules.vtkCommonDataModel import vtkImageData

    rng = np.random.default_rng(2)
    image = vtkImageData()
    image.SetExtent(-3, 36, 5, 30, 100, 140)
    image.SetOrigin(1, -2, 3)
    image.SetSpacing(0.5, 0.25, 2)
    shape = (40, 26, 41)
    points = {}
    for name, kind in [("f", "f4"), ("d", "f8"), ("c", "i1"), ("s", "i2"), ("l", "i8"), ("u", "u1")]:
        points[name] = rng.integers(0, 3, shape).astype(kind) if kind[0] != "f" else rng.normal(size=shape).astype(kind)
    points["v"] = rng.normal(size=shape + (3,)).astype("f4")
    cells = rng.normal(size=(39, 25, 40))

    def add(to, name, array):
        flat = array.swapaxes(0, 2).reshape((-1,) + array.shape[3:])
        values = numpy_to_vtk(np.ascontiguousarray(flat), deep=True)
        values.SetName(name)
        to.AddArray(values)

    for name, array in points.items():
        add(image.GetPointData(), name, array)
    add(image.GetCellData(), "cells", cells)
    writer = vtk_io.vtkXMLImageDataWriter()
    writer.SetFileName(str(tmp_path / "a.vti"))
    writer.SetInputData(image)
    getattr(writer, f"SetDataModeTo{mode}")()
    writer.SetEncodeAppendedData(encoded)
    if not compressed:
        writer.SetCompressorTypeToNone()
    getattr(writer, "SetHeaderTypeToUInt64" if wide else "SetHeaderTypeToUInt32")()
    assert writer.Write()

    with vln.open(tmp_path / "a.vti") as file:
        assert file.skipped == [] and len(file.volumes) == 2
        low = np.array((-3, 5, 100))
        for name, array in points.items():
            found = file[name].to_numpy((low, low + shape))
            # As text VTK writes floats with fewer digits than they have.
            same = np.allclose(found, array, rtol=1e-4, atol=1e-4) if mode == "Ascii" else np.array_equal(found, array)
            assert same, name
        found = file["cells"].to_numpy((low, low + cells.shape))
        assert np.allclose(found, cells, rtol=1e-4, atol=1e-4) and (mode == "Ascii" or np.array_equal(found, cells))
        assert np.allclose(file["f"].volume.to_world([(0, 0, 0)]), [(1, -2, 3)])
        assert np.allclose(file["f"].volume.to_world([(1, 1, 1)]), [(1.5, -1.75, 5)])
        assert np.allclose(file["cells"].volume.to_world([(0, 0, 0)]), [(1.25, -1.875, 4)])


def check_image(group, channel, folder):
    """All levels of an OME-Zarr image against the channel; returns the number of chunks that are there."""
    volume = channel.volume
    (scales,) = group.attrs["multiscales"]
    assert scales["version"] == "0.4" and [a["name"] for a in scales["axes"]][-3:] == ["z", "y", "x"]
    assert [a["type"] for a in scales["axes"]][-3:] == ["space"] * 3
    depths = sorted(volume.tiles_by_depth, reverse=True)
    assert len(depths) == len(scales["datasets"]) == len(list(group.arrays()))
    boxes = [b for b in (volume[name].box for name in volume.names) if b is not None]
    box = np.min([b[0] for b in boxes], axis=0), np.max([b[1] for b in boxes], axis=0)
    chunks = 0
    for depth, level in zip(depths, scales["datasets"]):
        array = group[level["path"]]
        width = 2 ** (28 - depth)
        wanted = channel.to_numpy(box, depth)
        found = np.moveaxis(array[:], 0, -1).transpose(2, 1, 0, 3) if wanted.ndim == 4 else array[:].transpose(2, 1, 0)
        assert found.dtype == wanted.dtype and np.array_equal(found, wanted), depth
        assert set(array.chunks[-3:]) <= set(range(1, 65)) and array.compressor.codec_id == "zlib"
        scale, shift = level["coordinateTransformations"]
        assert (scale["type"], shift["type"]) == ("scale", "translation")
        low = np.asarray(box[0]) // width
        for place in [(0, 0, 0), (3, 1, 2)]:
            world = np.multiply(scale["scale"][-3:], place[::-1]) + shift["translation"][-3:]
            assert np.allclose(world[::-1], volume.to_world([(low + place) * width])[0], rtol=1e-9)
        # zarr counts the chunks of arrays that lie in folders of folders wrongly
        written = sum(p.is_file() and p.name.isdigit() for p in (folder / array.path).rglob("*"))
        assert written <= array.nchunks
        chunks += written
    return chunks


def test_requirement_zarr_has_every_level_and_value(bunny, tmp_path):
    zarr = pytest.importorskip("zarr")
    bunny.save(tmp_path / "a.zarr")
    group = zarr.open_group(str(tmp_path / "a.zarr"), mode="r")
    assert len(bunny.volume.tiles_by_depth) > 1
    assert check_image(group, bunny["ls_bunny"], tmp_path / "a.zarr") > 4
    volume, _ = volume_of_many()
    volume.add("far", background=0.5).set([(-300, 8, 100), (700, 40, 108)], 2)
    volume.save(tmp_path / "b.zarr/")
    group = zarr.open_group(str(tmp_path / "b.zarr"), mode="r")
    assert group.attrs["bioformats2raw.layout"] == 3
    names = json.loads((tmp_path / "b.zarr/OME/.zattrs").read_text())["series"]
    assert names == [name.replace("/", "_") for name in volume.names]
    for name in volume.names:
        check_image(group[name.replace("/", "_")], volume[name], tmp_path / "b.zarr")
    written = [p for p in (tmp_path / "b.zarr/far/0").rglob("*") if p.is_file() and p.name.isdigit()]
    assert group["far/0"].nchunks == 16 and len(written) == 2


def test_requirement_zarr_holds_coarse_values_as_they_were_made(tmp_path):
    zarr = pytest.importorskip("zarr")
    volume = vln.Volume.from_numpy(np.random.default_rng(1).uniform(1, 2, (32, 16, 64)).astype("f4"), voxel_size=0.5)
    volume.set_coarse_values()
    volume.save(tmp_path / "a.zarr")
    group = zarr.open_group(str(tmp_path / "a.zarr"), mode="r")
    check_image(group, volume["density"], tmp_path / "a.zarr")
    assert np.array_equal(group["1"][:], group["0"][::2, ::2, ::2])


def test_requirement_zarr_keeps_anisotropic_voxels_several_volumes_and_backgrounds(tmp_path):
    zarr = pytest.importorskip("zarr")
    peer = pytest.importorskip("pyopenvdb")
    grids = []
    for name, background, diagonal in [("a", np.nan, (0.5, 2, 0.125)), ("b", -np.inf, (1, 1, 1)), ("c", 3, (1, 1, 1))]:
        grid = peer.FloatGrid(float(background))
        grid.name = name
        matrix = np.diag(diagonal + (1,)).astype(float)
        matrix[3, :3] = (3, -1, 2)
        grid.transform = peer.createLinearTransform(matrix.tolist())
        grid.copyFromArray(np.random.default_rng(5).uniform(1, 2, (30, 9, 20)), ijk=(-70000, 0, 8))
        grid.fill((-60000, 0, 0), (-59900, 70, 70), 7.0)
        grids.append(grid)
    peer.write(str(tmp_path / "a.vdb"), grids=grids)
    with vln.open(tmp_path / "a.vdb") as file:
        assert len(file.volumes) == 2
        file.save(tmp_path / "a.zarr")
        group = zarr.open_group(str(tmp_path / "a.zarr"), mode="r")
        for name in "abc":
            array = group[name]["0"]
            wanted = file[name].to_numpy(file[name].box)
            assert np.array_equal(array[:].transpose(2, 1, 0), wanted, equal_nan=True)
            scale = group[name].attrs["multiscales"][0]["datasets"][0]["coordinateTransformations"][0]["scale"]
            assert scale[::-1] == list(grids["abc".index(name)].transform.voxelSize())


def test_regression_names_need_not_be_text(tmp_path):
    volume = vln.Volume()
    name = os.fsdecode(b"den\xffsity")
    volume.add(name).set((0, 0, 0), 1)
    assert volume.names == [name] and volume[name].get((0, 0, 0)) == 1
    repr(volume), repr(volume[name]), volume.info(), volume[name]._repr_html_().encode()
    for suffix in ["vdb", "npz", "vti", "zarr"]:
        path = tmp_path / f"a.{suffix}"
        volume.save(path)
        if suffix != "zarr":
            with vln.open(path) as file:
                assert len(file.names) == 1 and file[file.names[0]].get((0, 0, 0)) == 1
    with vln.open(tmp_path / "a.vdb") as file:
        assert file.names == [name]
    odd = os.fsencode(tmp_path) + b"/\xfe.vdb"
    volume.save(odd)
    with vln.open(odd) as file:
        assert file.names == [name]
    with pytest.raises(FileNotFoundError):
        vln.open(os.fsencode(tmp_path) + b"/\xfd.vdb")
    with pytest.raises(KeyError):
        volume["\udcfe"]


def test_requirement_surfaces_scenes_and_flat_files(tmp_path):
    x, y, z = np.mgrid[-14:15, -14:15, -14:15]
    distance = np.clip((np.sqrt(x * x + y * y + z * z) - 10) * 0.1, -0.3, 0.3).astype("f4")
    volume = vln.Volume.from_numpy(distance, voxel_size=0.1, background=0.3, name="surface", grid_class="level set")
    for suffix in ("nvtt", "usda", "ply"):
        volume.save(tmp_path / f"a.{suffix}")
    box = volume["surface"].box
    for suffix in ("nvtt", "vdb"):  # the scene names the .vdb file beside it
        with vln.open(tmp_path / f"a.{suffix}") as file:
            assert np.array_equal(file["surface"].to_numpy(box), volume["surface"].to_numpy(box))
    scene = (tmp_path / "a.usda").read_text()
    assert 'def OpenVDBAsset "surface"' in scene and "@./a.vdb@" in scene
    with vln.open(tmp_path / "a.ply") as file:
        # Distances from the surface's mesh, on voxels of their own size; the middle of the ball is (14, 14, 14).
        rng = np.random.default_rng(3)
        ways = rng.normal(size=(500, 3))
        ways /= np.linalg.norm(ways, axis=1)[:, None]
        found = file["surface"].sample(1.4 + ways)
        assert np.abs(found).max() < 0.01
