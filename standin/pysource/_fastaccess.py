"""Fast-path helpers of the analysis engine: the category logger and clock helpers.

Logging is off by default.  ``EnableLogging(path_or_file, categories)`` turns it
on for some categories (all when None); a logger created afterwards, or one that
already exists, then writes one line per call to the shared file.
"""
from __future__ import annotations

import time
from typing import IO, Any

_gOutputFile: IO[str] | None = None
_gOwnsFile = False
_gCategories: frozenset[str] | None = None


def EnableLogging(path_or_file: str | IO[str], categories=None) -> None:
    """Log the given categories (all if None) to a path or an open text file."""
    global _gOutputFile, _gOwnsFile, _gCategories
    DisableLogging()
    if isinstance(path_or_file, str):
        _gOutputFile = open(path_or_file, 'a', encoding='utf-8')  # noqa: SIM115
        _gOwnsFile = True
    else:
        _gOutputFile = path_or_file
        _gOwnsFile = False
    _gCategories = None if categories is None else frozenset(categories)


def DisableLogging() -> None:
    global _gOutputFile, _gOwnsFile, _gCategories
    if _gOwnsFile and _gOutputFile is not None:
        _gOutputFile.close()
    _gOutputFile = None
    _gOwnsFile = False
    _gCategories = None


class CLogger:
    """A category logger: ``log(msg)`` or ``log(fmt, *values)`` writes one line."""

    def __init__(self, category: str) -> None:
        self.fCategory = category

    @property
    def fOutputFile(self) -> IO[str] | None:
        """The file lines go to, or None when logging is off for this category."""
        if _gOutputFile is None:
            return None
        if _gCategories is not None and self.fCategory not in _gCategories:
            return None
        return _gOutputFile

    def __call__(self, msg: Any, *values: Any) -> None:
        out = self.fOutputFile
        if out is None:
            return
        text = (msg % values) if values else str(msg)
        out.write(f'{time.time():.3f} [{self.fCategory}] {text.rstrip()}\n')

    def Log1(self, fmt: str, a: Any) -> None:
        self(fmt, a)

    def Log2(self, fmt: str, a: Any, b: Any) -> None:
        self(fmt, a, b)

    def Log3(self, fmt: str, a: Any, b: Any, c: Any) -> None:
        self(fmt, a, b, c)


def GetNowTime() -> float:
    return time.time()


def OutOfTime(end_time: float) -> bool:
    return time.time() >= end_time
