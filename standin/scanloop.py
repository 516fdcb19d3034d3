"""Running the main loop until a scan job is done.

The coordinator's idle callback ends when its ready queue is empty, but work may
still be coming: remote agents answer after their latency (parked work is then
released and scanners waiting for data resume), and a helper process returns
its results later.  ``RunUntilDone`` dispatches idles, and while something is
still outstanding it blocks on the next timeout instead of returning.
"""
from __future__ import annotations

import sys
from collections.abc import Callable, Iterable

from guiutils import ostrelgtk


def RunUntilDone(outstanding: Iterable[Callable[[], bool]] = (),
                 stop: Callable[[], bool] | None = None,
                 max_iterations: int = sys.maxsize) -> bool:
    """Dispatch until no idle is pending and none of ``outstanding`` reports
    work in flight.  Returns False when ``stop()`` became true or the bound was
    hit, True otherwise (work that can never proceed, such as files whose
    inspection failed, does not keep it running)."""
    checks = list(outstanding)
    loop = ostrelgtk.GetMainLoop()
    left = max_iterations
    while left > 0:
        if not ostrelgtk.run_until_idle(left, stop):
            return False
        left -= 1
        if not any(check() for check in checks):
            return True
        if stop is not None and stop():
            return False
        loop.iteration(may_block=True)
    return False
