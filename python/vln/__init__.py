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
from ._picture import Picture
from ._points import Points
from ._vln import FINEST, OPENVDB_VERSION, VERSION, FileError, Flat
from ._view import Page
from ._volume import Volume

__version__ = VERSION

__all__ = [
    "Channel",
    "FINEST",
    "File",
    "FileError",
    "Flat",
    "OPENVDB_VERSION",
    "Page",
    "Picture",
    "Points",
    "Volume",
    "WritableChannel",
    "open",
]
