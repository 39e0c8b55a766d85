"""Pages that show a volume in a browser."""

from __future__ import annotations

import html
import os
import shutil
import subprocess
import tempfile
from typing import Any, List, Optional, Sequence, Union

from ._bytes import FileBytes


class Page(FileBytes):
    """The bytes of one HTML page that needs nothing else; a notebook shows it in a frame."""

    def _repr_html_(self) -> str:
        source = html.escape(self.decode("utf-8", "replace"))
        return f'<iframe srcdoc="{source}" width="800" height="600" sandbox="allow-scripts allow-downloads"></iframe>'


def _program(program: Optional[Any]) -> str:
    wanted = os.fspath(program) if program is not None else os.environ.get("VLN_PROGRAM", "vln")
    found = shutil.which(wanted)
    if found is None:
        raise FileNotFoundError(f"the program {wanted!r}, which makes pages, is not there: install it, or name it")
    return found


def view(volume: Any, channels: Union[str, Sequence[str]], max_size: Union[str, int],
         program: Optional[Any]) -> Page:
    executable = _program(program)
    names: List[str] = [channels] if isinstance(channels, str) else list(channels)
    for name in names:
        volume[name]
    with tempfile.TemporaryDirectory() as folder:
        source, target = os.path.join(folder, "volume.vdb"), os.path.join(folder, "page.html")
        volume.save(source)
        command = [executable, "view", source, "-o", target, "--max-size", str(max_size)]
        for name in names:
            command += ["--channel", name]
        done = subprocess.run(command, stdin=subprocess.DEVNULL, stdout=subprocess.DEVNULL, stderr=subprocess.PIPE)
        if done.returncode != 0:
            lines = done.stderr.decode("utf-8", "replace").strip().splitlines()
            raise RuntimeError(lines[-1] if lines else f"{executable} ended with {done.returncode}")
        with open(target, "rb") as file:
            return Page(file.read())
