"""Files that are held as bytes."""

from __future__ import annotations

from typing import Any

from . import _checks


class FileBytes(bytes):
    """The bytes of a file of some kind."""

    def save(self, path: Any) -> None:
        with open(_checks.path_of(path), "wb") as file:
            file.write(self)

    def __repr__(self) -> str:
        return f"<vln.{type(self).__name__} of {len(self)} bytes>"

    __str__ = __repr__
