"""Files of volumes and points."""

from __future__ import annotations

import errno
import os
from typing import Any, Callable, Dict, List, Optional, Tuple

from . import _checks, _vln
from ._channel import Channel
from ._mapping import ByName
from ._points import Points
from ._volume import Volume

Progress = Callable[[str, float], Any]


class File(ByName):
    """The content of a file: a mapping from the names of its grids to channels.

    Grids of one transform share a Volume. Everything is in memory; close(), or the end of a with statement,
    lets go of it, and what was taken out before stays valid.
    """

    def __init__(self, path: str, volumes: List[Volume], points: List[Points], skipped: List[Tuple[str, str]]) -> None:
        self.path = path
        self._volumes: Optional[List[Volume]] = volumes
        self._points: List[Points] = points
        self._skipped = skipped

    def _held(self) -> List[Volume]:
        if self._volumes is None:
            raise ValueError("the file is closed")
        return self._volumes

    @property
    def volumes(self) -> List[Volume]:
        return list(self._held())

    @property
    def volume(self) -> Volume:
        """The only volume."""
        volumes = self._held()
        if len(volumes) != 1:
            raise ValueError(f"{self.path} holds {len(volumes)} volumes, each with a transform of its own")
        return volumes[0]

    @property
    def points(self) -> List[Points]:
        self._held()
        return list(self._points)

    @property
    def skipped(self) -> List[Tuple[str, str]]:
        """Grids that were not read, and why."""
        return list(self._skipped)

    @property
    def names(self) -> List[str]:
        return [name for volume in self._held() for name in volume.names]

    def __getitem__(self, name: str) -> Channel:
        for volume in self._held():
            if name in volume:
                return volume[name]
        raise KeyError(f"{self.path} has no grid {name!r}; it has {', '.join(self.names) or 'none'}")

    def save(self, path: Any, progress: Optional[Progress] = None) -> None:
        """Writes all volumes and points as .vdb, several volumes also as .zarr; a file of one volume and no points
        in any format that Volume.save() knows."""
        target = _checks.path_of(path)
        volumes = self._held()
        if len(volumes) == 1 and not self._points:
            volumes[0].save(target, progress=progress)
            return
        kind = _checks.suffix_of(target)
        if kind != ".vdb" and (kind != ".zarr" or self._points):
            raise _vln.FileError(f"{target}: several volumes, or points, are written as .vdb")
        _vln.save_file([v._core for v in volumes], [p._as_dict() for p in self._points], target, False, progress)

    def info(self) -> Dict[str, Any]:
        return {
            "path": self.path,
            "volumes": [volume.info() for volume in self._held()],
            "points": {points.name: len(points) for points in self._points},
            "skipped": self.skipped,
        }

    def close(self) -> None:
        self._volumes = None
        self._points = []

    @property
    def closed(self) -> bool:
        return self._volumes is None

    def __enter__(self) -> "File":
        self._held()
        return self

    def __exit__(self, *unused: object) -> None:
        self.close()

    def __repr__(self) -> str:
        if self.closed:
            return f"<vln.File '{self.path}' closed>"
        return f"<vln.File '{self.path}': {', '.join(self.names) or 'no grids'}>"


def open(
    path: Any,
    channels: str = "",
    progress: Optional[Progress] = None,
    memory: int = 0,
) -> File:
    """Reads a file of volumes: .vdb, .nvdb, .nvtt, .npz, .vti, or a mesh (.obj, .stl, .ply), which becomes a level set.

    channels: a filter of grids by name, such as "density* | velocity".
    progress: called as progress(stage, share) now and then; what it raises ends the call.
    memory: most bytes that reading may take; by default three quarters of what the machine has left.
    Raises FileNotFoundError, or FileError with one line that names the file and what is wrong with it.
    """
    name = _checks.path_of(path)
    if not os.path.lexists(name):
        raise FileNotFoundError(errno.ENOENT, os.strerror(errno.ENOENT), name)
    if os.path.isdir(name):
        raise IsADirectoryError(errno.EISDIR, os.strerror(errno.EISDIR), name)
    if progress is not None and not callable(progress):
        raise TypeError("progress must be callable")
    if not isinstance(channels, str):
        raise TypeError("channels must be a string")
    cores, points, skipped = _vln.open_file(name, channels, float(memory), progress)
    return File(name, [Volume._of(core) for core in cores], [Points._of(p) for p in points], list(skipped))
