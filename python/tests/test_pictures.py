"""Pictures by rays."""

import struct
import zlib

import numpy as np
import pytest

import vln


def pixels(png):
    """Of an opaque PNG file, (height, width, 3)."""
    assert png[:8] == b"\x89PNG\r\n\x1a\n"
    at, data = 8, b""
    while at < len(png):
        length, kind = struct.unpack(">I4s", png[at : at + 8])
        if kind == b"IHDR":
            width, height, depth, color = struct.unpack(">IIBB", png[at + 8 : at + 18])
            assert (depth, color) == (8, 2)
        if kind == b"IDAT":
            data += png[at + 8 : at + 8 + length]
        at += length + 12
    rows = np.frombuffer(zlib.decompress(data), np.uint8).reshape(height, 1 + 3 * width).astype(int)
    result = np.zeros((height, width, 3), int)
    for y in range(height):
        kind, line = rows[y, 0], rows[y, 1:].reshape(width, 3)
        above = result[y - 1] if y else np.zeros((width, 3), int)
        for x in range(width):
            a = result[y, x - 1] if x else np.zeros(3, int)
            c = above[x - 1] if x else np.zeros(3, int)
            b = above[x]
            p = a + b - c
            paeth = np.where((abs(p - a) <= abs(p - b)) & (abs(p - a) <= abs(p - c)), a,
                             np.where(abs(p - b) <= abs(p - c), b, c))
            result[y, x] = (line[x] + (0, a, b, (a + b) // 2, paeth)[kind]) % 256
    return result


def ball():
    x = np.arange(48)
    d = np.sqrt(((np.stack(np.meshgrid(x, x, x, indexing="ij"), -1) - 23.5) ** 2).sum(-1)) - 15
    return np.clip(d, -3, 3).astype(np.float32)


def test_requirement_a_level_set_is_a_surface_about_the_middle(tmp_path):
    volume = vln.Volume.from_numpy(ball(), voxel_size=0.1, background=3, name="surface", grid_class="level set")
    told = []
    picture = volume.render(size=(64, 48), progress=lambda stage, share: told.append(share))
    assert told and picture._repr_png_() == picture and isinstance(picture, vln.Picture)
    seen = pixels(picture)
    assert seen.shape == (48, 64, 3)
    ground = seen[0, 0]
    assert (seen[0, -1] == ground).all() and (seen[-1, 0] == ground).all()
    assert (seen[24, 32] != ground).any()
    covered = (seen != ground).any(axis=2)
    assert np.allclose(np.argwhere(covered).mean(axis=0), (23.5, 31.5), atol=4)
    assert 0.2 < covered.mean() < 0.6
    assert repr(picture) == str(picture) == f"<vln.Picture of {len(picture)} bytes>"
    picture.save(tmp_path / "a.png")
    assert (tmp_path / "a.png").read_bytes() == picture
    assert volume["surface"].render(size=(64, 48)) == picture
    assert volume["surface"].render(size=(64, 48), azimuth=0, mode="surface", iso=0) == picture


def test_requirement_modes_and_ranges_are_taken():
    volume = vln.Volume.from_numpy(np.random.default_rng(4).uniform(0, 1, (20, 20, 20)))
    pictures = {mode: volume.render(size=(32, 32), mode=mode) for mode in ["fog", "isosurface", "mip", "mean"]}
    assert len(set(pictures.values())) == 4
    assert volume.render(size=(32, 32), mode="mip", clim=(0, 10)) != pictures["mip"]
    assert volume.render(size=(32, 32), mode="mip", cmap="inferno") != pictures["mip"]


def test_negative_what_cannot_be_drawn_is_told():
    volume = vln.Volume()
    with pytest.raises(ValueError, match="no channel"):
        volume.render()
    volume.add("a").set((0, 0, 0), 1)
    for wrong in [{"mode": "x"}, {"size": (0, 5)}, {"mode": "surface", "iso": 7}, {"cmap": "none of them"}]:
        with pytest.raises(ValueError):
            volume.render(**wrong)
    with pytest.raises(TypeError):
        volume.render(nonsense=1)
    with pytest.raises(KeyError):
        volume.render("b")

    class Enough(Exception):
        pass

    def stop(stage, share):
        raise Enough

    with pytest.raises(Enough):
        volume.render(progress=stop)
