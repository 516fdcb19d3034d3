"""Reporting of unexpected exceptions to the application's log."""
from __future__ import annotations

import logging
import sys

kLoggerName = 'ostrel.reflect'

_gLog = logging.getLogger(kLoggerName)


def ReportCurrentException(message: str | None = None) -> None:
    """Log the exception being handled, with its traceback, at level ERROR.

    Call it from an ``except`` block.  Outside one it logs that nothing was being
    handled, so a misplaced call is visible rather than silent.
    """
    exc = sys.exc_info()[1]
    if exc is None:
        _gLog.error('%s (no exception is being handled)',
                    message or 'ReportCurrentException called')
        return
    _gLog.error('%s: %s: %s', message or 'Unexpected exception',
                type(exc).__name__, exc, exc_info=True)
