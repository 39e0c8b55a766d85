"""A volume as one flat buffer."""

from __future__ import annotations

from typing import Any, Dict, Optional, Tuple

import numpy as np

from . import _checks, _vln


class Flat:
    """A flat buffer: bytes that readers on a CPU or a GPU take as they are. Read-only.

    It is given on without a copy through the buffer protocol, __array_interface__ and DLPack.
    """

    __slots__ = ("_core", "__weakref__")

    def __init__(self, core: _vln.Flat) -> None:
        self._core = core

    @property
    def nbytes(self) -> int:
        return self._core.nbytes

    @property
    def seconds(self) -> float:
        """What the conversion took."""
        return self._core.seconds

    def __len__(self) -> int:
        return self._core.nbytes

    def to_numpy(self) -> np.ndarray:
        """The bytes, without a copy. Keeps the buffer alive."""
        return np.frombuffer(self._core, dtype=np.uint8)

    def __buffer__(self, flags: int) -> memoryview:
        return memoryview(self._core)

    def __bytes__(self) -> bytes:
        return bytes(memoryview(self._core))

    @property
    def __array_interface__(self) -> Dict[str, Any]:
        return {"shape": (self.nbytes,), "typestr": "|u1", "version": 3, "data": (self._core.address, True)}

    def __dlpack__(self, stream: Optional[Any] = None) -> Any:
        return self._core.dlpack()

    def __dlpack_device__(self) -> Tuple[int, int]:
        return (1, 0)

    def save(self, path: Any) -> None:
        """Writes a .nvtt file."""
        self._core.save(_checks.path_of(path))

    def __repr__(self) -> str:
        return f"<vln.Flat {self.nbytes} bytes>"
