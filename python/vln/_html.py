"""Tables for notebooks."""

from __future__ import annotations

import base64
import html
from typing import Any, Dict, Optional


def table(title: str, rows: Dict[str, Any], png: Optional[bytes] = None) -> str:
    lines = [f"<b>{html.escape(title)}</b><table>"]
    for key, value in rows.items():
        lines.append(f"<tr><td>{html.escape(str(key))}</td><td>{html.escape(str(value))}</td></tr>")
    lines.append("</table>")
    if png is not None:
        lines.append(f'<img src="data:image/png;base64,{base64.b64encode(png).decode()}"/>')
    # Names may hold bytes that are no text, which a notebook would not take.
    return "".join(lines).encode("utf-8", "replace").decode("utf-8")
