"""Sparse hierarchical volumes: open them, look at them as numpy arrays, sample, change and save them.

    import vln

    with vln.open("bunny.vdb") as file:
        density = file["density"]
        dense = density.to_numpy()
        values = density.sample(positions)
"""

from __future__ import annotations

from ._channel import Channel, WritableChannel
from ._file import File, open
from ._flat import Flat
from ._points import Points
from ._vln import FINEST, FileError, OPENVDB_VERSION
from ._volume import Volume

__version__ = "0.1.0"

__all__ = [
    "Channel",
    "FINEST",
    "File",
    "FileError",
    "Flat",
    "OPENVDB_VERSION",
    "Points",
    "Volume",
    "WritableChannel",
    "open",
]
