"""Pictures by rays."""

from __future__ import annotations

from typing import Any, Callable, Dict, Optional, Tuple

from ._bytes import FileBytes
from ._vln import Core


class Picture(FileBytes):
    """The bytes of a PNG file, which a notebook shows."""

    def _repr_png_(self) -> bytes:
        return bytes(self)


def render(
    core: Core,
    name: str,
    size: Tuple[int, int] = (512, 512),
    mode: Optional[str] = None,
    iso: Optional[float] = None,
    clim: Optional[Tuple[float, float]] = None,
    cmap: str = "",
    samples: int = 0,
    azimuth: float = 0.0,
    elevation: float = 0.0,
    zoom: float = 1.0,
    progress: Optional[Callable[[str, float], Any]] = None,
) -> Picture:
    width, height = (int(v) for v in size)
    if not (1 <= width <= 16384 and 1 <= height <= 16384):
        raise ValueError("size is (width, height), each 1 to 16384")
    if progress is not None and not callable(progress):
        raise TypeError("progress must be callable")
    how: Dict[str, Any] = {"cmap": str(cmap), "samples": int(samples), "azimuth": float(azimuth),
                           "elevation": float(elevation), "zoom": float(zoom)}
    if mode is not None:
        how["mode"] = str(mode)
    if iso is not None:
        how["iso"] = float(iso)
    if clim is not None:
        low, high = clim
        how["clim"] = (float(low), float(high))
    return Picture(core.render(name, width, height, how, progress))
