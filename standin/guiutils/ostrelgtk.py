"""The application's main loop: idle and timeout sources dispatched by priority.

Design note
-----------
The loop owns every pending source in ``_fSources`` (id -> ``_CSource``) and keeps
two heaps of entries pointing into it:

- ``_fReady``: ``(priority, seq, id)`` for sources that may run now: every idle,
  and every timeout whose due time has passed.  Lower priority values run first;
  ``seq`` is taken from one counter when an entry is pushed, so sources of equal
  priority run in the order they became ready (FIFO).  An idle that asks to run
  again gets a fresh ``seq`` and goes behind its equals (round robin).
- ``_fTimers``: ``(due_ms, seq, id)`` for timeouts waiting for their due time.
  Each dispatch first moves the due ones to ``_fReady`` ("promotion").

A source is in at most one heap at a time and its ``fSeq`` names the one live
entry; any other entry for it is stale and skipped when it reaches the top.  This
makes removal O(1): drop the source from ``_fSources`` and forget its ``fSeq``.
While a source's callback runs it is in no heap (``fSeq`` is None), so a nested
``iteration()`` from inside the callback never dispatches it again.

Reentrancy: a callback may add or remove sources, itself included, and may run
nested iterations.  Every helper that calls out to Python code (a callback, a
destroy hook of an owner) leaves ``_fSources`` and the heaps consistent first;
after the callback returns, ``fRemoved`` says whether someone removed the source
meanwhile, in which case it is not re-armed.

Sources made with the ``_while_alive`` forms register a destroy hook on their
owner (``_register_destroy_hook``); the hook removes the source.  The hook is
unregistered whenever the source ends in any other way, so a long-lived owner
does not accumulate hooks of finished sources.

A callback that raises is reported through ``reflect.ReportCurrentException()``
and its source is removed; the loop itself stays usable.

Time is a monotonic clock in milliseconds.  Tests replace it with ``set_clock``
(``CFakeClock`` advances only when told to, and its ``sleep`` advances it, so a
blocking iteration with a fake clock returns at once).
"""
from __future__ import annotations

import functools
import heapq
import itertools
import time
from collections.abc import Callable
from typing import Any

from ostrelutils import reflect

PRIORITY_HIGH = -100
PRIORITY_DEFAULT = 0
PRIORITY_HIGH_IDLE = 100
PRIORITY_DEFAULT_IDLE = 200
PRIORITY_LOW = 300


def _MonotonicMs() -> float:
    return time.monotonic() * 1000.0


class CFakeClock:
    """A manually advanced millisecond clock for tests; ``sleep`` advances it."""

    def __init__(self, start_ms: float = 0.0) -> None:
        self.fNowMs = float(start_ms)

    def __call__(self) -> float:
        return self.fNowMs

    def advance(self, ms: float) -> None:
        self.fNowMs += ms

    def sleep(self, seconds: float) -> None:
        self.fNowMs += seconds * 1000.0


class _CSource:
    """One pending idle (``fIntervalMs`` None) or timeout."""

    __slots__ = (
        'fArgs',
        'fCallback',
        'fHookToken',
        'fId',
        'fIntervalMs',
        'fOwner',
        'fPriority',
        'fRemoved',
        'fSeq',
    )

    def __init__(self, sid: int, callback: Callable[..., Any], args: tuple,
                 priority: int, interval_ms: float | None) -> None:
        self.fId = sid
        self.fCallback: Callable[..., Any] | None = callback
        self.fArgs = args
        self.fPriority = int(priority)
        self.fIntervalMs = interval_ms
        self.fSeq: int | None = None
        self.fOwner: Any = None
        self.fHookToken: Any = None
        self.fRemoved = False


class CMainLoop:
    """Idle and timeout sources with the dispatch rules described in the module note."""

    def __init__(self) -> None:
        self._fSources: dict[int, _CSource] = {}
        self._fReady: list[tuple[int, int, int]] = []
        self._fTimers: list[tuple[float, int, int]] = []
        self._fSeqCounter = itertools.count()
        self._fIdCounter = itertools.count(1)
        self._fClock: Callable[[], float] = _MonotonicMs
        self._fSleep: Callable[[float], None] = time.sleep
        self._fQuitFlags: list[list[bool]] = []

    # -- clock -------------------------------------------------------------

    def set_clock(self, clock: Callable[[], float] | None = None) -> None:
        """Use ``clock()`` (milliseconds, never decreasing) as the loop's time source.

        None restores the real monotonic clock.  If the clock object has a
        ``sleep(seconds)`` method, blocking waits call it instead of ``time.sleep``.
        """
        self._fClock = clock if clock is not None else _MonotonicMs
        self._fSleep = getattr(clock, 'sleep', None) or time.sleep

    def now_ms(self) -> float:
        return self._fClock()

    # -- adding and removing -------------------------------------------------

    def idle_add(self, callback: Callable[..., Any], *args: Any,
                 priority: int = PRIORITY_DEFAULT_IDLE) -> int:
        src = self._NewSource(callback, args, priority, None)
        self._PushReady(src)
        return src.fId

    def timeout_add(self, interval_ms: float, callback: Callable[..., Any], *args: Any,
                    priority: int = PRIORITY_DEFAULT) -> int:
        if interval_ms < 0:
            raise ValueError('timeout interval must not be negative')
        src = self._NewSource(callback, args, priority, float(interval_ms))
        self._PushTimer(src, self._fClock() + src.fIntervalMs)
        return src.fId

    def idle_add_while_alive(self, callback: Callable[..., Any], owner: Any, *args: Any,
                             priority: int = PRIORITY_DEFAULT_IDLE) -> int:
        sid = self.idle_add(callback, *args, priority=priority)
        self._TieToOwner(sid, owner)
        return sid

    def timeout_add_while_alive(self, interval_ms: float, callback: Callable[..., Any],
                                owner: Any, *args: Any,
                                priority: int = PRIORITY_DEFAULT) -> int:
        sid = self.timeout_add(interval_ms, callback, *args, priority=priority)
        self._TieToOwner(sid, owner)
        return sid

    def source_remove(self, sid: Any) -> bool:
        """Remove a pending source; False (and no effect) for an unknown or ended id."""
        if type(sid) is not int:  # not one of our ids (and True must not mean 1)
            return False
        src = self._fSources.get(sid)
        if src is None:
            return False
        self._Remove(src)
        return True

    def has_source(self, sid: int) -> bool:
        return sid in self._fSources

    def source_count(self) -> int:
        return len(self._fSources)

    def reset(self) -> None:
        """Drop every source (unregistering owner hooks) and restore the real clock."""
        sources = list(self._fSources.values())
        for src in sources:
            self._Remove(src)
        self._fReady.clear()
        self._fTimers.clear()
        self._fQuitFlags.clear()
        self.set_clock(None)

    # -- dispatching ---------------------------------------------------------

    def pending(self) -> bool:
        """Whether some source is ready to run now."""
        self._PromoteDueTimers()
        return self._PeekReady() is not None

    def iteration(self, may_block: bool = False) -> bool:
        """Dispatch the highest-priority ready source; return whether one ran.

        With ``may_block`` and nothing ready, wait for the earliest timeout first.
        Nothing can wake a loop with no sources at all, so that case returns False.
        """
        self._PromoteDueTimers()
        src = self._PopReady()
        if src is None and may_block:
            while src is None and self._HasLiveTimer():
                wait_ms = self._fTimers[0][0] - self._fClock()
                if wait_ms > 0:
                    self._fSleep(wait_ms / 1000.0)
                self._PromoteDueTimers()
                src = self._PopReady()
        if src is None:
            return False
        self._Dispatch(src)
        return True

    def run(self) -> None:
        """Dispatch until ``quit()`` is called, or until nothing is left that could
        ever run (no ready source and no timeout: only another thread could add
        one, and sources belong to the main thread)."""
        flag = [False]
        self._fQuitFlags.append(flag)
        try:
            while not flag[0]:
                if not self.iteration(may_block=True):
                    break
        finally:
            self._fQuitFlags.remove(flag)

    def quit(self) -> None:
        """Make the innermost ``run()`` return after the current dispatch."""
        if self._fQuitFlags:
            self._fQuitFlags[-1][0] = True

    def run_until_idle(self, max_iterations: int = 10000,
                       stop: Callable[[], bool] | None = None) -> bool:
        """Dispatch until no idle source is pending, at most ``max_iterations`` times,
        and (with ``stop``) only while ``stop()`` is false: checked before each
        dispatch, so a signal handler that sets a flag stops the loop between two
        callbacks.

        Due timeouts run too (by priority).  Returns True when no idle is pending at
        the end, False when the bound was hit, ``stop()`` became true or the pending
        idles cannot run (for example the one whose callback called this).
        """
        for _ in range(max_iterations):
            if not self._HasPendingIdle():
                return True
            if stop is not None and stop():
                return False
            if not self.iteration(False):
                return False
        return not self._HasPendingIdle()

    # -- internals -----------------------------------------------------------

    def _NewSource(self, callback: Callable[..., Any], args: tuple, priority: int,
                   interval_ms: float | None) -> _CSource:
        if not callable(callback):
            raise TypeError('callback must be callable')
        src = _CSource(next(self._fIdCounter), callback, args, priority, interval_ms)
        self._fSources[src.fId] = src
        return src

    def _PushReady(self, src: _CSource) -> None:
        src.fSeq = next(self._fSeqCounter)
        heapq.heappush(self._fReady, (src.fPriority, src.fSeq, src.fId))

    def _PushTimer(self, src: _CSource, due_ms: float) -> None:
        src.fSeq = next(self._fSeqCounter)
        heapq.heappush(self._fTimers, (due_ms, src.fSeq, src.fId))

    def _IsLive(self, seq: int, sid: int) -> _CSource | None:
        src = self._fSources.get(sid)
        if src is None or src.fSeq != seq:
            return None
        return src

    def _PromoteDueTimers(self) -> None:
        now = self._fClock()
        timers = self._fTimers
        while timers and timers[0][0] <= now:
            _due, seq, sid = heapq.heappop(timers)
            src = self._IsLive(seq, sid)
            if src is not None:
                self._PushReady(src)

    def _HasLiveTimer(self) -> bool:
        timers = self._fTimers
        while timers and self._IsLive(timers[0][1], timers[0][2]) is None:
            heapq.heappop(timers)
        return bool(timers)

    def _PeekReady(self) -> _CSource | None:
        ready = self._fReady
        while ready:
            _prio, seq, sid = ready[0]
            src = self._IsLive(seq, sid)
            if src is not None:
                return src
            heapq.heappop(ready)
        return None

    def _PopReady(self) -> _CSource | None:
        src = self._PeekReady()
        if src is not None:
            heapq.heappop(self._fReady)
            src.fSeq = None  # dispatching: in no heap
        return src

    def _HasPendingIdle(self) -> bool:
        return any(src.fIntervalMs is None for src in self._fSources.values())

    def _Dispatch(self, src: _CSource) -> None:
        started_ms = self._fClock()
        callback = src.fCallback
        assert callback is not None
        try:
            keep = callback(*src.fArgs)
        except Exception:  # noqa: BLE001 - reported; the loop must survive any callback
            reflect.ReportCurrentException()
            keep = False
        except BaseException:
            if not src.fRemoved:
                self._Remove(src)
            raise
        if src.fRemoved:
            return
        if keep:
            if src.fIntervalMs is None:
                self._PushReady(src)
            else:
                self._PushTimer(src, started_ms + src.fIntervalMs)
        else:
            self._Remove(src)

    def _Remove(self, src: _CSource) -> None:
        # State first, then the one call-out (unregistering the owner's hook).
        self._fSources.pop(src.fId, None)
        src.fRemoved = True
        src.fSeq = None
        owner, token = src.fOwner, src.fHookToken
        src.fOwner = src.fHookToken = None
        src.fCallback = None
        src.fArgs = ()
        if token is not None:
            owner._unregister_destroy_hook(token)

    def _TieToOwner(self, sid: int, owner: Any) -> None:
        hook = functools.partial(self._CB_OwnerDestroyed, sid)
        try:
            token = owner._register_destroy_hook(hook)
        except BaseException:
            self.source_remove(sid)  # an owner that cannot own it gets no source
            raise
        src = self._fSources.get(sid)
        if src is None:
            # The owner was already destroyed: the hook ran at once and removed it.
            return
        src.fOwner = owner
        src.fHookToken = token

    def _CB_OwnerDestroyed(self, sid: int) -> None:
        src = self._fSources.get(sid)
        if src is None:
            return
        src.fHookToken = None  # consumed by the owner; nothing to unregister
        self._Remove(src)


_gLoop = CMainLoop()


def GetMainLoop() -> CMainLoop:
    """The application's one main loop."""
    return _gLoop


def idle_add(callback: Callable[..., Any], *args: Any,
             priority: int = PRIORITY_DEFAULT_IDLE) -> int:
    """Call ``callback(*args)`` when idle, again while it returns a true value."""
    return _gLoop.idle_add(callback, *args, priority=priority)


def idle_add_while_alive(callback: Callable[..., Any], owner: Any, *args: Any,
                         priority: int = PRIORITY_DEFAULT_IDLE) -> int:
    """As ``idle_add``, and removed when ``owner`` (a CDestroyable) is destroyed."""
    return _gLoop.idle_add_while_alive(callback, owner, *args, priority=priority)


def idle_remove(sid: Any) -> bool:
    """Remove an idle (or any source); unknown and finished ids are ignored."""
    return _gLoop.source_remove(sid)


def timeout_add(interval_ms: float, callback: Callable[..., Any], *args: Any,
                priority: int = PRIORITY_DEFAULT) -> int:
    """Call ``callback(*args)`` every ``interval_ms`` while it returns a true value."""
    return _gLoop.timeout_add(interval_ms, callback, *args, priority=priority)


def timeout_add_while_alive(interval_ms: float, callback: Callable[..., Any], owner: Any,
                            *args: Any, priority: int = PRIORITY_DEFAULT) -> int:
    """As ``timeout_add``, and removed when ``owner`` is destroyed."""
    return _gLoop.timeout_add_while_alive(interval_ms, callback, owner, *args,
                                          priority=priority)


def timeout_remove(sid: Any) -> bool:
    """Remove a timeout (or any source); unknown and finished ids are ignored."""
    return _gLoop.source_remove(sid)


def iteration(may_block: bool = False) -> bool:
    return _gLoop.iteration(may_block)


def pending() -> bool:
    return _gLoop.pending()


def run() -> None:
    _gLoop.run()


def quit() -> None:
    _gLoop.quit()


def run_until_idle(max_iterations: int = 10000,
                   stop: Callable[[], bool] | None = None) -> bool:
    return _gLoop.run_until_idle(max_iterations, stop)


def set_clock(clock: Callable[[], float] | None) -> None:
    _gLoop.set_clock(clock)


def reset() -> None:
    _gLoop.reset()


class NoArgCallback:
    """A callable that accepts any arguments and calls ``fn()`` with none."""

    __slots__ = ('fFunc',)

    def __init__(self, fn: Callable[[], Any]) -> None:
        self.fFunc = fn

    def __call__(self, *args: Any, **kwargs: Any) -> Any:
        return self.fFunc()

    def __repr__(self) -> str:
        return f'NoArgCallback({self.fFunc!r})'


class NoObjCallback:
    """A callable that drops its first argument (the emitter) and passes the rest."""

    __slots__ = ('fFunc',)

    def __init__(self, fn: Callable[..., Any]) -> None:
        self.fFunc = fn

    def __call__(self, obj: Any, *args: Any, **kwargs: Any) -> Any:
        return self.fFunc(*args, **kwargs)

    def __repr__(self) -> str:
        return f'NoObjCallback({self.fFunc!r})'
