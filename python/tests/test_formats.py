"""Dense files, read back by the tools that people use."""

import shutil
import subprocess

import numpy as np
import pytest

import vln


def volume_of_many():
    rng = np.random.default_rng(3)
    shape = (9, 14, 7)
    volume = vln.Volume(0.25, (1, 2, 3))
    ijk = np.argwhere(np.ones(shape, bool)) + (-4, 8, 100)
    arrays = {}
    for name, dtype, inner in [("f", np.float32, ()), ("d", np.float64, ()), ("i", np.int32, ()), ("l", np.int64, ()),
                               ("b", bool, ()), ("v", np.float32, (3,)), ("w", np.float64, (3,)), ("x", np.int32, (3,)),
                               ("a/b & <c>", np.float32, ())]:
        array = rng.integers(0, 2 if dtype is bool else 1000, shape + inner).astype(dtype)
        array[0, 0, 0] = array[-1, -1, -1] = 1
        volume.add(name, dtype, shape=inner).set(ijk, array.reshape(-1, *inner))
        arrays[name] = array
    return volume, arrays


def test_requirement_npz_is_read_by_numpy(tmp_path):
    volume, arrays = volume_of_many()
    told = []
    volume.save(tmp_path / "a.npz", progress=lambda stage, share: told.append(share))
    assert told[0] == 0 and told[-1] == 1
    with np.load(tmp_path / "a.npz") as file:
        assert np.array_equal(file["low"], (-4, 8, 100))
        for name, array in arrays.items():
            found = file[name.replace("/", "_")]
            assert found.dtype == array.dtype and np.array_equal(found, array), name
        corner = file["to_world"] @ (1, 2, 3, 1)
        assert np.allclose(corner[:3], volume.to_world((-3, 10, 103)))
    volume.save(tmp_path / "b.npz", box=((-4, 8, 100), (-2, 10, 101)))
    with np.load(tmp_path / "b.npz") as file:
        assert np.array_equal(file["v"], arrays["v"][:2, :2, :1])
    volume.save(tmp_path / "c.npz")
    assert (tmp_path / "a.npz").read_bytes() == (tmp_path / "c.npz").read_bytes()
    if shutil.which("unzip"):
        assert subprocess.run(["unzip", "-tq", tmp_path / "a.npz"]).returncode == 0


def test_requirement_coarse_depths_are_written(bunny, tmp_path):
    bunny.volume.save(tmp_path / "a.npz", depth=26)
    with np.load(tmp_path / "a.npz") as file:
        assert np.array_equal(file["ls_bunny"], bunny["ls_bunny"].to_numpy(depth=26))
        assert np.allclose((file["to_world"] @ (1, 0, 0, 1))[:3], bunny.volume.to_world((file["low"] + (1, 0, 0)) * 4))


def read_vti(path):
    vtk_io = pytest.importorskip("vtkmodules.vtkIOXML")
    from vtkmodules.util.numpy_support import vtk_to_numpy

    reader = vtk_io.vtkXMLImageDataReader()
    reader.SetFileName(str(path))
    reader.Update()
    image = reader.GetOutput()
    shape = image.GetDimensions()
    arrays = {}
    for n in range(image.GetPointData().GetNumberOfArrays()):
        array = image.GetPointData().GetArray(n)
        values = vtk_to_numpy(array)
        arrays[array.GetName()] = values.reshape(shape[::-1] + values.shape[1:]).swapaxes(0, 2)
    return image, arrays


def test_requirement_vti_is_read_by_vtk(tmp_path):
    volume, arrays = volume_of_many()
    volume.save(tmp_path / "a.vti")
    image, found = read_vti(tmp_path / "a.vti")
    assert image.GetExtent() == (-4, 4, 8, 21, 100, 106)
    for name, array in arrays.items():
        assert np.array_equal(found[name], array), name
    for ijk in [(-4, 8, 100), (3, 10, 105)]:
        point = image.GetPoint(image.ComputePointId(ijk))
        assert np.allclose(point, volume.to_world(ijk))


def test_requirement_a_whole_level_set_goes_to_both(bunny, tmp_path):
    dense = bunny["ls_bunny"].to_numpy()
    bunny.save(tmp_path / "a.npz")
    with np.load(tmp_path / "a.npz") as file:
        assert np.array_equal(file["ls_bunny"], dense)
    bunny.save(tmp_path / "a.vti")
    assert np.array_equal(read_vti(tmp_path / "a.vti")[1]["ls_bunny"], dense)


def levels_of(path):
    """Of a .vtkhdf file: for each level its spacing, its boxes, and its arrays box by box as [x, y, z]."""
    h5py = pytest.importorskip("h5py")
    with h5py.File(path, "r") as file:
        root = file["VTKHDF"]
        assert root.attrs["Type"] == b"OverlappingAMR" and tuple(root.attrs["Version"]) == (1, 0)
        levels = []
        for n in range(len(root)):
            level = root[f"Level{n}"]
            boxes, arrays = level["AMRBox"][:].astype(np.int64), {}
            for name, values in level["CellData"].items():
                values, parts, at = values[:], [], 0
                for box in boxes:
                    x, y, z = box[1::2] - box[::2] + 1
                    part = values[at : at + x * y * z]
                    at += len(part)
                    parts.append(part.reshape((z, y, x) + part.shape[1:]).swapaxes(0, 2))
                assert at == len(values)
                arrays[name] = parts
            levels.append((level.attrs["Spacing"], boxes, arrays))
        return root.attrs["Origin"], levels


def check_levels(path, volume):
    """All that such a file tells of a volume, against the volume; returns what levels_of() does."""
    origin, levels = levels_of(path)
    tiles = volume.tiles_by_depth
    depths = range(min(tiles), max(tiles) + 1)
    assert len(levels) == len(depths)
    unit = volume.to_world([(1, 1, 1)])[0] - volume.to_world([(0, 0, 0)])[0]
    for depth, (spacing, boxes, arrays) in zip(depths, levels):
        width = 2 ** (28 - depth)
        assert np.allclose(spacing, unit * width, rtol=1e-12)
        # The first voxel of a cell lies half a voxel behind the cell's corner.
        low = volume.to_index(origin + boxes[:, ::2] * spacing) + 0.5
        voxels = np.rint(low).astype(int)
        assert np.abs(low - voxels).max() < 1e-3 and (voxels % (4 * width) == 0).all()
        sizes = boxes[:, 1::2] - boxes[:, ::2] + 1
        assert set(sizes.ravel()) <= {4, 8, 16, 32}
        inside = {tuple(t) for low, size in zip(voxels // (4 * width), sizes // 4)
                  for t in np.argwhere(np.ones(size, bool)) + low}
        assert len(inside) == sizes.prod(axis=1).sum() // 64
        if depth in tiles:
            assert {tuple(t) for t in volume.origins(depth) // (4 * width)} <= inside
        assert set(arrays) == {name.replace("/", "_") for name in volume.names}
        for name in volume.names:
            for box, size, part in zip(voxels, sizes, arrays[name.replace("/", "_")]):
                assert np.array_equal(part, volume[name].to_numpy(box=(box, box + size * width), depth=depth)), name
    return origin, levels


def test_requirement_vtkhdf_has_every_level_and_value(bunny, tmp_path):
    bunny.save(tmp_path / "a.vtkhdf")
    _, levels = check_levels(tmp_path / "a.vtkhdf", bunny.volume)
    assert len(levels) > 1 and any(32 in boxes[:, 1] - boxes[:, 0] + 1 for _, boxes, _ in levels)
    volume, arrays = volume_of_many()
    volume.save(tmp_path / "b.vtkhdf")
    check_levels(tmp_path / "b.vtkhdf", volume)


def test_requirement_vtkhdf_keeps_voxels_that_are_no_cubes(tmp_path):
    peer = pytest.importorskip("pyopenvdb")
    grid = peer.FloatGrid()
    grid.name = "ramp"
    grid.transform = peer.createLinearTransform([[0.5, 0, 0, 0], [0, 2, 0, 0], [0, 0, 0.125, 0], [3, -1, 2, 1]])
    grid.copyFromArray(np.random.default_rng(5).uniform(1, 2, (30, 9, 20)), ijk=(-70000, 0, 8))
    peer.write(str(tmp_path / "a.vdb"), grids=[grid])
    with vln.open(tmp_path / "a.vdb") as file:
        file.save(tmp_path / "a.vtkhdf")
        check_levels(tmp_path / "a.vtkhdf", file.volume)


def test_requirement_vtkhdf_is_read_by_vtk(bunny, tmp_path):
    vtk_io = pytest.importorskip("vtkmodules.vtkIOHDF")
    from vtkmodules.util.numpy_support import vtk_to_numpy
    from vtkmodules.vtkCommonCore import vtkVersion

    if (vtkVersion.GetVTKMajorVersion(), vtkVersion.GetVTKMinorVersion()) < (9, 2):
        pytest.skip("VTK reads such files from 9.2 on")
    bunny.volume.save(tmp_path / "a.vtkhdf")
    origin, levels = levels_of(tmp_path / "a.vtkhdf")
    reader = vtk_io.vtkHDFReader()
    assert reader.CanReadFile(str(tmp_path / "a.vtkhdf"))
    reader.SetFileName(str(tmp_path / "a.vtkhdf"))
    reader.Update()
    read = reader.GetOutputDataObject(0)
    assert read.GetNumberOfLevels() == len(levels)
    for n, (spacing, boxes, arrays) in enumerate(levels):
        assert read.GetNumberOfDataSets(n) == len(boxes)
        for k, box in enumerate(boxes):
            grid = read.GetDataSet(n, k)
            low = origin + box[::2] * spacing
            assert np.allclose(np.reshape(grid.GetBounds(), (3, 2))[:, 0], low)
            assert np.allclose(np.reshape(grid.GetBounds(), (3, 2))[:, 1], origin + (box[1::2] + 1) * spacing)
            values = vtk_to_numpy(grid.GetCellData().GetArray("ls_bunny"))
            assert np.array_equal(values, arrays["ls_bunny"][k].ravel(order="F"))


@pytest.mark.parametrize("suffix", ["npz", "vti"])
def test_negative_what_cannot_be_written_leaves_no_file(suffix, tmp_path):
    path = tmp_path / f"a.{suffix}"
    volume = vln.Volume()
    with pytest.raises(vln.FileError, match="no channel"):
        volume.save(path)
    channel = volume.add("a")
    with pytest.raises(vln.FileError, match="no active voxel"):
        volume.save(path)
    channel.set([(0, 0, 0), (2**26, 2**26, 2**26)], 1)
    with pytest.raises(vln.FileError, match="coarser depth"):
        volume.save(path)
    volume.save(path, depth=8)

    class Enough(Exception):
        pass

    def stop(stage, share):
        raise Enough

    before = path.read_bytes()
    with pytest.raises(Enough):
        volume.save(path, depth=7, progress=stop)
    assert path.read_bytes() == before and len(list(tmp_path.iterdir())) == 1


def test_requirement_a_turned_grid_stands_where_it_stood(tmp_path):
    peer = pytest.importorskip("pyopenvdb")
    grid = peer.FloatGrid()
    grid.name = "ramp"
    c, s = np.cos(0.6), np.sin(0.6)
    grid.transform = peer.createLinearTransform([[c / 2, s / 2, 0, 0], [-s, c, 0, 0], [0, 0, 0.25, 0], [3, -1, 2, 1]])
    ijk = np.argwhere(np.ones((24, 16, 16), bool)) + (-8, 0, 8)
    world = np.array([grid.transform.indexToWorld(tuple(float(v) for v in p)) for p in ijk])
    dense = (world @ (2, -1, 0.5) + 40).reshape(24, 16, 16)
    grid.copyFromArray(dense, ijk=(-8, 0, 8))
    peer.write(str(tmp_path / "a.vdb"), grids=[grid])

    file = vln.open(tmp_path / "a.vdb")
    assert "not one uniform scale" in file.volume.transform
    assert np.allclose(file.volume.to_world(ijk), world, atol=1e-12)
    assert np.allclose(file.volume.to_index(world), ijk, atol=1e-12)
    inside = file.volume.to_world(np.random.default_rng(1).uniform((-8, 0, 8), (14.9, 14.9, 22.9), (200, 3)))
    values, gradients = file["ramp"].sample(inside, gradient=True)
    assert np.allclose(values, inside @ (2, -1, 0.5) + 40, atol=1e-4)
    assert np.allclose(gradients, (2, -1, 0.5), atol=1e-3)

    file.save(tmp_path / "a.vti")
    image, found = read_vti(tmp_path / "a.vti")
    assert np.array_equal(found["ramp"], file["ramp"].to_numpy())
    for at in ijk[::997]:
        assert np.allclose(image.GetPoint(image.ComputePointId([int(v) for v in at])), file.volume.to_world(at))
    file.save(tmp_path / "a.npz")
    with np.load(tmp_path / "a.npz") as content:
        assert np.allclose((content["to_world"] @ (5, 6, 7, 1))[:3], file.volume.to_world(content["low"] + (5, 6, 7)))
