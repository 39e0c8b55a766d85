"""Points with attributes."""

from __future__ import annotations

from typing import Any, Dict, Mapping, Optional

import numpy as np

from . import _checks, _vln


class Points:
    """Positions in world space with named attributes, one value or vector for each point."""

    def __init__(
        self,
        positions: Any,
        attributes: Optional[Mapping[str, Any]] = None,
        voxel_size: float = 1.0,
        name: str = "points",
    ) -> None:
        rows, single = _checks.positions(positions, "positions")
        if single:
            raise ValueError("positions must be of shape (N, 3)")
        bad = ~np.isfinite(rows).all(axis=1)
        if bad.any():
            raise ValueError(f"row {int(bad.argmax())} of positions is no position: it is not finite")
        size = float(voxel_size)
        if not (np.isfinite(size) and size > 0):
            raise ValueError("voxel_size must be a positive number")
        self.name = str(name)
        self.voxel_size = size
        self.positions: np.ndarray = rows
        self.attributes: Dict[str, np.ndarray] = {}
        for key, value in (attributes or {}).items():
            array = _checks.numbers(value, f"attribute {key!r}")
            if array.ndim < 1 or len(array) != len(rows):
                raise ValueError(f"attribute {key!r} has {array.shape} values for {len(rows)} points")
            if array.dtype == np.dtype(bool):
                array = array.view(np.uint8)
            _checks.element_type(array.dtype, array.shape[1:])
            self.attributes[str(key)] = np.ascontiguousarray(array, dtype=array.dtype.newbyteorder("="))

    @classmethod
    def _of(cls, found: Dict[str, Any]) -> "Points":
        return cls(found["positions"], found["attributes"], found["voxel_size"], found["name"])

    def _as_dict(self) -> Dict[str, Any]:
        checked = Points(self.positions, self.attributes, self.voxel_size, self.name)
        return {
            "name": checked.name,
            "positions": checked.positions,
            "attributes": checked.attributes,
            "voxel_size": checked.voxel_size,
        }

    def __len__(self) -> int:
        return len(self.positions)

    def __getitem__(self, name: str) -> np.ndarray:
        if name not in self.attributes:
            raise KeyError(f"the points have no attribute {name!r}; they have {', '.join(self.attributes) or 'none'}")
        return self.attributes[name]

    def save(self, path: Any) -> None:
        """Writes a .vdb or .ply file. Positions are stored as floats relative to the first point."""
        _vln.save_points(self._as_dict(), _checks.path_of(path))

    def __repr__(self) -> str:
        return f"<vln.Points '{self.name}': {len(self)} points, attributes {', '.join(self.attributes) or 'none'}>"
