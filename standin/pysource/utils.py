"""Utilities of the analysis engine."""
from __future__ import annotations

from typing import Any

kPythonExtensions = ('.py', '.pyw', '.pyi', '.pi')


def IsPythonSource(loc: Any) -> bool:
    """True when the location holds Python source.

    Decided by the extension; a local file without an extension counts when its
    first line is a ``#!`` line naming python.
    """
    url = getattr(loc, 'fUrl', None)
    if not isinstance(url, str):
        return False
    base = url.rsplit('/', 1)[-1]
    if base.lower().endswith(kPythonExtensions):
        return True
    if '.' in base or not loc.IsReady():
        return False
    try:
        if not loc.GetStat().exists or loc.IsDir():
            return False
        head = loc.ReadBytes()[:200]
    except (OSError, RuntimeError):
        return False
    first = head.split(b'\n', 1)[0]
    return first.startswith(b'#!') and b'python' in first
