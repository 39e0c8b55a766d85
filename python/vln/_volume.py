"""A tree of tiles with fields on it."""

from __future__ import annotations

from typing import Any, Callable, Dict, List, Mapping, Optional, Sequence, Tuple, Union

import numpy as np

from . import _checks, _html, _view, _vln
from ._channel import Channel, _box, _depth, _three
from ._mapping import ByName
from ._picture import Picture
from ._points import Points
from ._view import Page
from ._vln import FINEST, Flat

Where = Callable[[np.ndarray, int], Any]
_CHILDREN = np.array([(i & 1, i >> 1 & 1, i >> 2) for i in range(8)], dtype=np.int64)
_LOWEST, _HIGHEST = -(2**31), 2**31 - 1


class Volume(ByName):
    """A tree of tiles, with fields ("channels") on it: a mapping from names to channels.

    Indices are those of the deepest depth, and world = origin + voxel_size * index unless a file says
    otherwise. Several threads may use a volume: calls that read run at once, one that changes waits for them.
    """

    __slots__ = ("_core",)

    def __init__(self, voxel_size: float = 1.0, origin: Any = (0.0, 0.0, 0.0)) -> None:
        size = float(voxel_size)
        with np.errstate(over="ignore"):
            if not (np.isfinite(np.float32(size)) and np.float32(size) > 0):
                raise ValueError(f"voxel_size must be a positive number, not {voxel_size!r}")
        start = _checks.numbers(origin, "origin").astype(np.float64)
        if start.shape != (3,) or not np.isfinite(start).all():
            raise ValueError("origin must be three finite numbers")
        self._core = _vln.Core(size, (float(start[0]), float(start[1]), float(start[2])))

    @classmethod
    def _of(cls, core: _vln.Core) -> "Volume":
        volume = cls.__new__(cls)
        volume._core = core
        return volume

    # Made of arrays

    @staticmethod
    def from_numpy(
        array: Any,
        voxel_size: float = 1.0,
        origin: Any = (0.0, 0.0, 0.0),
        background: Any = 0,
        tolerance: float = 0.0,
        name: str = "density",
        grid_class: str = "",
        low: Any = (0, 0, 0),
    ) -> "Volume":
        """A volume with one channel, from an array indexed [x, y, z], or [x, y, z, component].

        Any strides and any byte order will do: what counts is the index. float16 becomes float32; what no
        channel holds is refused. Element [0, 0, 0] goes to the index `low`. Tiles are made where some value lies
        farther than `tolerance` from the background; values that do not become the background.
        grid_class: what .vdb files are told, such as "level set" or "fog volume".
        """
        dense = _checks.numbers(array, "array")
        if dense.ndim not in (3, 4, 5):
            raise ValueError(f"array must have 3 axes, or 4 with components last, not {dense.ndim}")
        if dense.dtype == np.dtype(np.float16):
            dense = dense.astype(np.float32)
        near = float(tolerance)
        if not near >= 0:
            raise ValueError("tolerance must be 0 or more")
        kind = _checks.element_type(dense.dtype, dense.shape[3:])
        dense = dense.view(np.uint8) if kind == "bool" else dense.astype(dense.dtype.newbyteorder("="), copy=False)
        volume = Volume(voxel_size, origin)
        volume.add(name, dtype=bool if kind == "bool" else dense.dtype, shape=dense.shape[3:],
                   background=background, grid_class=grid_class)
        volume._core.from_numpy(name, dense, _checks.long3(low, "low"), near)
        return volume

    @staticmethod
    def from_points(
        xyz: Any,
        voxel_size: float = 1.0,
        attributes: Optional[Mapping[str, Any]] = None,
        name: str = "points",
    ) -> Points:
        """Points with attributes, to be saved as .vdb or .ply."""
        return Points(xyz, attributes, voxel_size, name)

    # Channels

    @property
    def names(self) -> List[str]:
        return self._core.names()

    def __getitem__(self, name: str) -> Channel:
        if not isinstance(name, str):
            raise TypeError(f"channels have names: strings, not {type(name).__name__}")
        if name not in self.names:
            raise KeyError(f"the volume has no channel {name!r}; it has {', '.join(self.names) or 'none'}")
        return Channel(self._core, name)

    def __delitem__(self, name: str) -> None:
        self[name]
        self._core.remove_channel(name)

    def add(
        self,
        name: str,
        dtype: Any = np.float32,
        background: Any = 0,
        shape: Tuple[int, ...] = (),
        grid_class: str = "",
    ) -> Channel:
        """Makes a channel. `shape` is that of an element: (3,) for vectors."""
        if not isinstance(name, str):
            raise TypeError("a channel's name must be a string")
        kind = _checks.element_type(dtype, tuple(shape))
        stored = np.dtype(np.uint8) if kind == "bool" else np.dtype(dtype).newbyteorder("=")
        value = _checks.exactly(np.asarray(background) != 0 if kind == "bool" else background, stored, "background")
        try:
            value = np.ascontiguousarray(np.broadcast_to(value, tuple(shape))).reshape(tuple(shape))
        except ValueError:
            raise ValueError(f"a background of shape {value.shape} does not fit {tuple(shape)}") from None
        self._core.add(name, kind, value, str(grid_class))
        return Channel(self._core, name)

    # Space

    @property
    def voxel_size(self) -> float:
        return self._core.voxel_size()

    @property
    def transform(self) -> str:
        """Empty for one uniform scale, else what the transform is."""
        return self._core.besides_scale()

    def to_world(self, ijk: Any) -> np.ndarray:
        rows, single = _checks.positions(ijk, "ijk")
        result = self._core.to_world(rows)
        return result[0] if single else result

    def to_index(self, xyz: Any) -> np.ndarray:
        rows, single = _checks.positions(xyz)
        result = self._core.to_index(rows)
        return result[0] if single else result

    # The tree

    @property
    def tile_count(self) -> int:
        return sum(self._core.tile_counts())

    @property
    def tiles_by_depth(self) -> Dict[int, int]:
        return {d: n for d, n in enumerate(self._core.tile_counts()) if n > 0}

    def origins(self, depth: int = FINEST) -> np.ndarray:
        """The low corners of the tiles of a depth, (tiles, 3) int32."""
        return self._core.origins(_depth(depth))

    def refine(self, low: Any, high: Any, where: Optional[Where] = None, depth: int = FINEST) -> None:
        """Makes tiles from the roots over a box of indices downwards. Values that are read stay what they are.

        where: called for each depth as where(corners, width), corners (N, 3): says, as N bools, which tiles
        to make; below a tile that is not made there is none. By default all down to `depth`.
        """
        first, last = _checks.long3(low, "low"), _checks.long3(high, "high")
        level = _depth(depth)
        if where is None:
            tiles = 1.0
            for a, b in zip(first, last):
                tiles *= max(0, b - a) / (4 << (FINEST - level)) + 1
            if tiles > 1e9:
                raise MemoryError(f"refining that box would make about {tiles:.0e} tiles")
            self._core.refine_all(_clip(first), _clip(last), level)
            return
        if not callable(where):
            raise TypeError("where must be callable, as where(corners, width)")
        if any(a >= b for a, b in zip(first, last)):
            return
        root = self._core.root_depth()
        width = 4 << (FINEST - root)
        box = [(max(a, _LOWEST) // width * width, min(b, _HIGHEST)) for a, b in zip(first, last)]
        counts = [max(0, -(-(b - a) // width)) for a, b in box]
        if counts[0] * counts[1] * counts[2] > 10**7:
            raise MemoryError("the box meets more than ten million roots")
        axes = [a + width * np.arange(n, dtype=np.int64) for (a, _), n in zip(box, counts)]
        frontier = np.stack(np.meshgrid(*axes, indexing="ij"), axis=-1).reshape(-1, 3)
        accepted: List[np.ndarray] = []
        for d in range(root + 1, level + 1):
            width = 4 << (FINEST - d)
            frontier = (frontier[:, None, :] + _CHILDREN * width).reshape(-1, 3)
            inside = ((frontier + width > np.array(first)) & (frontier < np.array(last))).all(axis=1)
            frontier = frontier[inside]
            frontier = frontier[_mask(where(frontier.astype(np.int32), width), len(frontier))]
            if len(frontier) == 0:
                break
            accepted.append(np.ascontiguousarray(frontier, dtype=np.int32))
        if accepted:
            self._core.refine_tiles(accepted, root + 1)

    def remove(self, where: Any) -> int:
        """Removes tiles of the deepest depth: those for which where(corners, width) says so, or a mask over
        origins(). There coarser samples are read. Returns how many went."""
        corners = self.origins()
        mask = _mask(where(corners, 4) if callable(where) else where, len(corners))
        return self._core.remove_tiles(np.ascontiguousarray(corners[mask]))

    def fill_halos(self, name: Optional[str] = None) -> None:
        """Fills the layer of neighbours' values round the tiles of a channel, or of all."""
        if name is not None:
            self[name]
        self._core.fill_halos(name)

    def set_coarse_values(self) -> None:
        """Coarse samples take the values of the finer ones below them, in all channels."""
        self._core.fill_coarse()

    # Out

    def render(self, channel: str = "", **how: Any) -> Picture:
        """A picture of a channel, see Channel.render(); by default of "density" or "surface", or of the first that has
        active voxels."""
        if not channel:
            seen = [name for name in self.names if self[name].box is not None]
            if not seen:
                raise ValueError("the volume has no channel with active voxels")
            channel = next((name for name in ("density", "surface") if name in seen), seen[0])
        return self[channel].render(**how)

    def view(self, channels: Union[str, Sequence[str]] = (), max_size: Union[str, int] = "20MB",
             program: Optional[Any] = None) -> Page:
        """A page that shows the volume in a browser, by the program vln where it was built with pages.

        channels: one or several; by default those that the program chooses.
        max_size: "20MB" or a number of bytes, which chooses the depth.
        program: its path; else the environment's VLN_PROGRAM, else "vln" on the path.
        """
        return _view.view(self, channels, max_size, program)

    def save(
        self,
        path: Any,
        box: Optional[Any] = None,
        depth: Optional[int] = None,
        progress: Optional[Callable[[str, float], Any]] = None,
        sparse: bool = False,
    ) -> None:
        """Writes all channels, whole or not at all, in the format of the suffix: .vdb, .nvdb, .nvtt, .usda (with a
        .vdb beside it), .vtkhdf (ParaView, with all levels), .zarr (OME-Zarr, a folder with all levels), .ply (the
        surface of a level set), or dense as .npz (numpy) or .vti (ParaView).

        box: of .npz, .vti and .zarr; as in Channel.to_numpy().
        depth: of .npz and .vti; as there.
        progress: of these and of .npz that are sparse; as in open().
        sparse: of .npz, the active voxels one by one in place of a dense box.
        """
        target = _checks.path_of(path)
        kind = _checks.suffix_of(target)
        if progress is not None and not callable(progress):
            raise TypeError("progress must be callable")
        if sparse:
            if kind != ".npz" or box is not None or depth is not None:
                raise ValueError("sparse is for .npz files, without a box and a depth")
            _vln.save_file([self._core], [], target, True, progress)
            return
        if kind not in (".npz", ".vti", ".zarr"):
            if box is not None or depth is not None:
                raise ValueError("a box and a depth are those of dense files: .npz, .vti and, without a depth, .zarr")
            self._core.save(target)
            return
        if kind == ".zarr" and depth is not None:
            raise ValueError("a .zarr folder holds all depths")
        low, high = (0, 0, 0), (0, 0, 0)
        if box is not None:
            low, high = _box(box)
        else:
            boxes = [found for found in (self[name].box for name in self.names) if found is not None]
            if boxes:
                low = _three(np.min([b[0] for b in boxes], axis=0))
                high = _three(np.max([b[1] for b in boxes], axis=0))
        self._core.save_dense(target, low, high, FINEST if depth is None else _depth(depth), progress)

    def flatten(
        self,
        channels: str = "*",
        quantisation: str = "none",
        tolerance: float = -1.0,
        morton: bool = False,
        coalesce: bool = False,
        finest_level: int = 0,
        traversal: bool = False,
    ) -> Flat:
        """The volume as one flat buffer.

        quantisation: "none", "fp4", "fp8", "fp16", or "fpn" with a tolerance.
        finest_level: levels above the deepest at which the buffer ends.
        """
        return self._core.flatten(str(channels), str(quantisation), float(tolerance), bool(morton), bool(coalesce),
                                  int(finest_level), bool(traversal))

    @property
    def nbytes(self) -> int:
        """Memory of the tree and all channels."""
        return self._core.nbytes()

    def info(self) -> Dict[str, Any]:
        return {
            "voxel_size": self.voxel_size,
            "transform": self.transform,
            "tiles": self.tiles_by_depth,
            "bytes": self.nbytes,
            "channels": {name: self[name].info() for name in self.names},
        }

    def _repr_html_(self) -> str:
        info = self.info()
        channels = info.pop("channels")
        for name, channel in channels.items():
            info[f"channel {name}"] = f"{channel['type']}, {channel['active']} active in {channel['box']}"
        return _html.table("volume", info)

    def __repr__(self) -> str:
        tiles = self.tiles_by_depth
        levels = f"{len(tiles)} levels, {sum(tiles.values())} tiles" if tiles else "no tiles"
        names = ", ".join(self.names) or "no channels"
        return f"<vln.Volume {names}: {levels}, voxel size {self.voxel_size:g}, {self.nbytes} bytes>"


def _clip(p: Tuple[int, int, int]) -> Tuple[int, int, int]:
    low = [min(max(v, _LOWEST), _HIGHEST) for v in p]
    return (low[0], low[1], low[2])


def _mask(value: Any, count: int) -> np.ndarray:
    mask = np.asarray(value)
    if mask.dtype != np.dtype(bool):
        raise TypeError(f"which tiles must be told as bools, not {mask.dtype}")
    if mask.shape != (count,):
        raise ValueError(f"{mask.shape} bools for {count} tiles")
    return mask
