"""One field of a volume."""

from __future__ import annotations

import weakref
from typing import TYPE_CHECKING, Any, Dict, List, Optional, Tuple

import numpy as np

from . import _checks, _html
from ._picture import Picture, render
from ._vln import FINEST, Core

if TYPE_CHECKING:
    from ._volume import Volume

Box = Tuple[Tuple[int, int, int], Tuple[int, int, int]]


class Channel:
    """One field of a volume, by name. Indices are (x, y, z) of the deepest depth; arrays are indexed so too."""

    __slots__ = ("_core", "_name")

    def __init__(self, core: Core, name: str) -> None:
        core.type_of(name)  # raises where there is no such channel
        self._core = core
        self._name = name

    # What it is

    @property
    def name(self) -> str:
        return self._name

    @property
    def type(self) -> str:
        """The element type: "float", "float3", "uint8", ... or "bool"."""
        name, _, _, file_type = self._core.type_of(self._name)
        return "bool" if file_type in ("bool", "mask") else name

    @property
    def dtype(self) -> np.dtype:
        return np.dtype(bool) if self.type == "bool" else self._core.type_of(self._name)[1]

    @property
    def element_shape(self) -> Tuple[int, ...]:
        """() for numbers, (3,) for vectors of three."""
        return self._core.type_of(self._name)[2]

    @property
    def background(self) -> Any:
        """What is read where there are no tiles."""
        value = self._shown(self._core.background(self._name))
        return value[()] if value.ndim == 0 else value

    @property
    def volume(self) -> "Volume":
        from ._volume import Volume

        return Volume._of(self._core)

    @property
    def box(self) -> Optional[Box]:
        """The box round the active voxels, ((x0, y0, z0), (x1, y1, z1)), its end exclusive; None without one."""
        return self._core.box(self._name)

    @property
    def active_count(self) -> int:
        """How many voxels are active."""
        return self._core.active_count(self._name)

    def active(self) -> np.ndarray:
        """The indices of all active voxels, (N, 3) int32, those of wide active tiles one by one."""
        return self._core.active(self._name)

    def info(self) -> Dict[str, Any]:
        return {
            "name": self._name,
            "type": self.type,
            "background": np.asarray(self.background).tolist(),
            "active": self.active_count,
            "box": self.box,
        }

    # Dense

    def to_numpy(self, box: Optional[Any] = None, depth: Optional[int] = None) -> np.ndarray:
        """A dense copy, indexed [x, y, z] and, for vectors, [x, y, z, component]; x is fastest in memory.

        box: ((x0, y0, z0), (x1, y1, z1)) in indices of the deepest depth, its end exclusive; by default
        the box round the active voxels. Beyond the volume there is the background.
        depth: of the samples. Above the deepest each is 2, 4, 8, ... indices wide, and the array holds those
        that the box meets.
        """
        where = self.box if box is None else _box(box)
        level = FINEST if depth is None else _depth(depth)
        if where is None:
            low = high = (0, 0, 0)
        else:
            low, high = where
        width = 1 << (FINEST - level)
        first = [a // width for a in low]
        count = [max(0, -(-b // width) - f) if b > a else 0 for a, b, f in zip(low, high, first)]
        dense = self._core.to_numpy(self._name, _three(first), _three(count), level)
        return self._shown(dense).swapaxes(0, 2)

    # At positions

    def sample(self, xyz: Any, gradient: bool = False, space: str = "world") -> Any:
        """Values at positions of shape (N, 3), or at one of shape (3,), blended linearly between the samples.

        Integers and bools are those of the nearest sample. Outside there is the background.
        gradient: returns (values, gradients) as well, the gradients in the same space; float channels only.
        space: "world", or "index" for positions in indices of the deepest depth.
        """
        if space not in ("world", "index"):
            raise ValueError(f"space is 'world' or 'index', not {space!r}")
        rows, single = _checks.positions(xyz)
        found = self._core.sample(self._name, rows, bool(gradient), space == "world")
        if not gradient:
            values = self._shown(found)
            return values[0] if single else values
        values, slopes = self._shown(found[0]), found[1]
        return (values[0], slopes[0]) if single else (values, slopes)

    def get(self, ijk: Any) -> Any:
        """The values at indices of shape (N, 3), or at one of shape (3,)."""
        rows, single = _checks.indices(ijk)
        values = self._shown(self._core.get(self._name, rows))
        return values[0] if single else values

    def set(self, ijk: Any, values: Any) -> None:
        """Writes values at indices of shape (N, 3): makes the tiles that are missing. Of equal indices the last
        one counts. `values` may be one for all."""
        rows, _ = _checks.indices(ijk)
        stored = self._core.type_of(self._name)
        shape = (len(rows), *stored[2])
        given = _checks.numbers(values, "values")
        if self.type == "bool":
            given = given != 0
        array = _checks.exactly(given, stored[1], "values")
        if array.shape != shape:
            try:
                array = np.ascontiguousarray(np.broadcast_to(array, shape))
            except ValueError:
                raise ValueError(f"values of shape {array.shape} do not fit {len(rows)} indices") from None
        self._core.set(self._name, rows, array)

    # As a picture

    def png(self, axis: str = "z", at: Optional[float] = None, size: int = 512, gradient: bool = False) -> bytes:
        """A slice across an axis, "x", "y" or "z", at a world position on it (by default the middle of the box), as
        the bytes of a PNG file. gradient: draws the length of the gradient."""
        if axis not in ("x", "y", "z"):
            raise ValueError(f"axis is 'x', 'y' or 'z', not {axis!r}")
        where = None if at is None else float(at)
        return self._core.picture(self._name, "xyz".index(axis), where, int(size), bool(gradient))

    def render(self, **how: Any) -> Picture:
        """A picture by rays, as `vln render` draws it: fog or surface, as the class and the values say.

        size: (width, height) in pixels, by default (512, 512). mode: "fog", "surface", "isosurface", "mip" or
        "mean". iso: the value on the surface. clim: (low, high), the values of the first and the last colour. cmap:
        "viridis", "inferno", ... samples: for each pixel. azimuth, elevation: of the camera, in degrees; zoom.
        progress: as in open().
        """
        return render(self._core, self._name, **how)

    def _repr_png_(self) -> Optional[bytes]:
        try:
            return self.png(size=256)
        except ValueError:  # nothing to be drawn
            return None

    def _repr_html_(self) -> str:
        info = self.info()
        return _html.table(f"channel {self._name}", info, self._repr_png_())

    # In place

    def values(self, depth: int = FINEST) -> np.ndarray:
        """The elements of all tiles of a depth, (tiles, 64) or (tiles, 64, components), as they lie in memory:
        no copy, read-only. Element i + 4 j + 16 k of a tile is sample (i, j, k) of it; origins() tells
        where the tiles are.

        As long as such an array lives the volume cannot be changed: that raises BufferError.
        The first call packs a channel whose tiles lie apart, which is a copy within the volume.
        """
        return self._shown(self._core.values(self._name, _depth(depth), False))

    def origins(self, depth: int = FINEST) -> np.ndarray:
        """The low corners of the tiles of a depth, (tiles, 3) int32, in the order of values()."""
        return self._core.origins(_depth(depth))

    def writable(self) -> "WritableChannel":
        """with channel.writable() as w: w.values(depth) may be written until the block ends."""
        return WritableChannel(self)

    def _shown(self, array: np.ndarray) -> np.ndarray:
        return array.view(bool) if self.type == "bool" else array

    def __repr__(self) -> str:
        box = self.box
        what = "no active voxel" if box is None else f"{self.active_count} active voxels in {box[0]}..{box[1]}"
        return f"<vln.Channel '{self._name}' {self.type}: {what}, background {self.background}>"


class WritableChannel:
    """A channel whose values may be written in place, in a with statement."""

    def __init__(self, channel: Channel) -> None:
        self._channel = channel
        self._handed_out: List[Any] = []
        self._open = False

    def __enter__(self) -> "WritableChannel":
        self._channel._core.begin_write(self._channel.name)
        self._open = True
        return self

    def __exit__(self, *unused: object) -> None:
        self._open = False
        for reference in self._handed_out:
            array = reference()
            if array is not None:
                array.flags.writeable = False
        self._handed_out.clear()

    def values(self, depth: int = FINEST) -> np.ndarray:
        """As Channel.values(), but it may be written. Arrays made of it outside the block stay readable."""
        if not self._open:
            raise ValueError("values can be written only inside the with statement")
        channel = self._channel
        array = channel._shown(channel._core.values(channel.name, _depth(depth), True))
        self._handed_out.append(weakref.ref(array))
        return array

    def origins(self, depth: int = FINEST) -> np.ndarray:
        return self._channel.origins(depth)


def _depth(depth: Any) -> int:
    if isinstance(depth, bool) or not isinstance(depth, (int, np.integer)):
        raise TypeError("depth must be an integer")
    if not 0 <= depth <= FINEST:
        raise ValueError(f"depth {depth} is none: depths are 0 to {FINEST}")
    return int(depth)


def _box(box: Any) -> Box:
    try:
        low, high = box
    except (TypeError, ValueError):
        raise ValueError("a box is ((x0, y0, z0), (x1, y1, z1))") from None
    return _checks.long3(low, "box"), _checks.long3(high, "box")


def _three(values: Any) -> Tuple[int, int, int]:
    return (int(values[0]), int(values[1]), int(values[2]))
