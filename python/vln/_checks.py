"""What comes from the caller, as arrays that the core takes. Every message is one line."""

from __future__ import annotations

import os
from typing import Any, Tuple

import numpy as np

from . import _vln

Long3 = Tuple[int, int, int]
ELEMENT_TYPES = _vln.element_types()
SCALAR_TYPES = {
    str(dtype): name for name, (dtype, shape) in ELEMENT_TYPES.items() if shape == ()
}


def path_of(path: Any) -> str:
    text = os.fspath(path)
    if isinstance(text, bytes):
        text = os.fsdecode(text)
    if "\0" in text:
        raise ValueError("a path cannot hold a zero character")
    return text


def suffix_of(path: str) -> str:
    """".vdb"; of folders too, whose names may end with a slash."""
    return os.path.splitext(path.rstrip("/"))[1].lower()


def long3(value: Any, name: str) -> Long3:
    try:
        items = [int(v) for v in value]
        exact = all(int(v) == v for v in value)
    except (TypeError, ValueError, OverflowError):
        raise TypeError(f"{name} must be three integers") from None
    if len(items) != 3 or not exact:
        raise ValueError(f"{name} must be three integers")
    if any(abs(v) > 2**40 for v in items):
        raise ValueError(f"{name} holds a number that is beyond the reach of a volume")
    return (items[0], items[1], items[2])


def numbers(value: Any, name: str) -> np.ndarray:
    try:
        array = np.asarray(value)
    except ValueError:
        raise ValueError(f"{name} is no regular array") from None
    if array.dtype.kind not in "buif":
        raise TypeError(f"{name} must hold numbers, not {array.dtype}")
    return array


def positions(value: Any, name: str = "xyz") -> Tuple[np.ndarray, bool]:
    """An (N, 3) array of doubles, and whether the caller gave a single position."""
    array = numbers(value, name)
    single = array.ndim == 1 and array.shape[0] == 3
    if single:
        array = array.reshape(1, 3)
    if array.ndim != 2 or array.shape[1] != 3:
        raise ValueError(f"{name} must be of shape (N, 3), not {array.shape}")
    return np.ascontiguousarray(array, dtype=np.float64), single


def indices(value: Any, name: str = "ijk") -> Tuple[np.ndarray, bool]:
    """An (N, 3) array of int32, and whether the caller gave a single index."""
    array = numbers(value, name)
    if array.dtype.kind not in "ui" and array.size > 0:
        raise TypeError(f"{name} must hold integers, not {array.dtype}")
    single = array.ndim == 1 and array.shape[0] == 3
    if single:
        array = array.reshape(1, 3)
    if array.ndim != 2 or array.shape[1] != 3:
        raise ValueError(f"{name} must be of shape (N, 3), not {array.shape}")
    info = np.iinfo(np.int32)
    if array.size and (int(array.min()) < info.min or int(array.max()) > info.max):
        raise IndexError(f"{name} reaches beyond a volume's domain")
    return np.ascontiguousarray(array, dtype=np.int32), single


def element_type(dtype: Any, shape: Tuple[int, ...]) -> str:
    """The name of the element type for a dtype and the shape of an element; "bool" for bools."""
    kind = np.dtype(dtype)
    if kind == np.dtype(bool) and shape == ():
        return "bool"
    for name, (known, known_shape) in ELEMENT_TYPES.items():
        if known == kind.newbyteorder("=") and known_shape == shape:
            return name
    what = f"{kind}" + (f" x {shape}" if shape else "")
    raise TypeError(f"a channel cannot hold {what}")


def exactly(value: Any, dtype: np.dtype, name: str) -> np.ndarray:
    """The numbers in another dtype, refused where that would not hold them."""
    array = numbers(value, name)
    if array.dtype == dtype:
        return np.ascontiguousarray(array) if array.ndim else array.copy()
    if dtype.kind in "iu" and array.dtype.kind == "f":
        raise TypeError(f"{name} are {array.dtype} and the channel holds {dtype}: convert them first")
    if dtype.kind in "iu" and array.size:
        info = np.iinfo(dtype)
        if int(array.min()) < info.min or int(array.max()) > info.max:
            raise OverflowError(f"{name} reach beyond what {dtype} holds")
    return np.array(array, dtype=dtype, order="C")
