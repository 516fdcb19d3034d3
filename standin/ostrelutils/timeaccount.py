"""Where the time goes: self time per category of code, measured, not sampled.

Design note
-----------
``CTimeAccount`` keeps a stack of categories.  Timed code enters its category
on the way in and leaves it on the way out; the time between two such events
is charged to the category on top of the stack, so a nested call is counted
once, in the innermost category, and the caller's category gets only its own
("self") time.  Time spent with the stack empty is nobody's (the main loop
between callbacks, the program around it) and is not charged.

Timing is added from outside: ``Wrap`` returns a timed callable and
``TimeMethods`` replaces methods on a class by timed ones (``Restore`` puts
the originals back).  Each timed call costs two clock reads and a few list
operations (well under a microsecond on a current machine); that overhead is
charged partly to the caller's and partly to the callee's category.
"""
from __future__ import annotations

import functools
import time
from collections.abc import Callable, Iterable
from typing import Any

_kNow = time.perf_counter


class CTimeAccount:
    """Self time and number of entries per category."""

    def __init__(self) -> None:
        self.fSeconds: dict[str, float] = {}
        self.fCalls: dict[str, int] = {}
        self._fStack: list[str] = []
        self._fLast = _kNow()
        self._fRestore: list[tuple[Any, str, Any]] = []

    def Enter(self, category: str) -> None:
        now = _kNow()
        stack = self._fStack
        if stack:
            top = stack[-1]
            self.fSeconds[top] = self.fSeconds.get(top, 0.0) + (now - self._fLast)
        stack.append(category)
        self.fCalls[category] = self.fCalls.get(category, 0) + 1
        self._fLast = now

    def Leave(self) -> None:
        now = _kNow()
        top = self._fStack.pop()
        self.fSeconds[top] = self.fSeconds.get(top, 0.0) + (now - self._fLast)
        self._fLast = now

    def Seconds(self, category: str) -> float:
        return self.fSeconds.get(category, 0.0)

    def Calls(self, category: str) -> int:
        return self.fCalls.get(category, 0)

    def Wrap(self, fn: Callable[..., Any], category: str) -> Callable[..., Any]:
        """``fn`` with its calls charged to ``category``."""
        enter, leave = self.Enter, self.Leave

        @functools.wraps(fn)
        def timed(*args: Any, **kwargs: Any) -> Any:
            enter(category)
            try:
                return fn(*args, **kwargs)
            finally:
                leave()
        timed.__wrapped_by_account__ = self  # type: ignore[attr-defined]
        return timed

    def TimeMethods(self, owner: Any, names: Iterable[str], category: str) -> None:
        """Replace ``owner.name`` (a class or a module) by timed versions; the
        attribute found through ``owner`` (inherited ones too) is the one timed."""
        for name in names:
            original = owner.__dict__.get(name)
            if isinstance(original, (staticmethod, classmethod)):
                raise TypeError(f'cannot time {name!r}: static and class methods are not supported')
            self.Replace(owner, name, self.Wrap(getattr(owner, name), category))

    def Replace(self, owner: Any, name: str, value: Any) -> None:
        """Set ``owner.name`` to ``value`` until ``Restore``."""
        self._fRestore.append((owner, name, owner.__dict__.get(name)))
        setattr(owner, name, value)

    def Restore(self) -> None:
        """Undo every ``TimeMethods``, newest first."""
        while self._fRestore:
            owner, name, original = self._fRestore.pop()
            if original is None:
                delattr(owner, name)
            else:
                setattr(owner, name, original)
