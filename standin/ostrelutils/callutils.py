"""Small helpers for calling functions: optional callbacks, weak method references."""
from __future__ import annotations

import weakref
from collections.abc import Callable
from typing import Any

from ostrelutils import reflect


def CallIfCallable(fn: Callable[..., Any] | None, *args: Any, **kwargs: Any) -> Any:
    """Call ``fn`` when it is not None; return its result, or None."""
    if fn is None:
        return None
    return fn(*args, **kwargs)


def CallAndReport(fn: Callable[..., Any], *args: Any, **kwargs: Any) -> Any:
    """Call ``fn``; an exception is reported (not raised) and None returned."""
    try:
        return fn(*args, **kwargs)
    except Exception:  # noqa: BLE001 - reporting any failure is the point
        reflect.ReportCurrentException()
        return None


class CWeakMethod:
    """A callable holding its bound method weakly; a no-op once the object is gone."""

    def __init__(self, method: Any) -> None:
        self._fRef = weakref.WeakMethod(method)

    def __call__(self, *args: Any, **kwargs: Any) -> Any:
        method = self._fRef()
        if method is None:
            return None
        return method(*args, **kwargs)

    def IsAlive(self) -> bool:
        return self._fRef() is not None
