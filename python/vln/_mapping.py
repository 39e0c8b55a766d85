"""What volumes and files have in common."""

from __future__ import annotations

from typing import Iterator, List, Optional, Tuple

from ._channel import Channel


class ByName:
    """A mapping from names, in their order, to channels."""

    __slots__ = ()

    @property
    def names(self) -> List[str]:
        raise NotImplementedError

    def __getitem__(self, name: str) -> Channel:
        raise NotImplementedError

    def keys(self) -> List[str]:
        return self.names

    def values(self) -> List[Channel]:
        return [self[name] for name in self.names]

    def items(self) -> List[Tuple[str, Channel]]:
        return [(name, self[name]) for name in self.names]

    def get(self, name: str, default: Optional[Channel] = None) -> Optional[Channel]:
        return self[name] if name in self else default

    def __len__(self) -> int:
        return len(self.names)

    def __iter__(self) -> Iterator[str]:
        return iter(self.names)

    def __contains__(self, name: object) -> bool:
        return name in self.names
