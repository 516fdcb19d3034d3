"""The savable manager: notices files changed outside the application.

``CheckForExternalChanges`` compares the files' modification times with those
seen before and emits "external-files-changed" (manager, set of locations) for
the ones that changed; ``ReportExternalChanges`` emits it for given locations.
"""
from __future__ import annotations

from collections.abc import Iterable
from typing import Any

from ostrelbase import destroyable


class CSavableManager(destroyable.CDestroyable):
    def __init__(self) -> None:
        super().__init__(('external-files-changed',))
        self._fKnownMTimes: dict[Any, float] = {}

    def Watch(self, loc_seq: Iterable[Any]) -> None:
        """Remember the current modification times of the files."""
        for loc in loc_seq:
            self._fKnownMTimes[loc] = loc.GetMTime()

    def CheckForExternalChanges(self) -> set[Any]:
        changed = set()
        for loc, old in self._fKnownMTimes.items():
            now = loc.GetMTime()
            if now != old:
                self._fKnownMTimes[loc] = now
                changed.add(loc)
        if changed:
            self.emit('external-files-changed', self, changed)
        return changed

    def ReportExternalChanges(self, loc_seq: Iterable[Any]) -> None:
        changed = set(loc_seq)
        if changed:
            self.emit('external-files-changed', self, changed)
