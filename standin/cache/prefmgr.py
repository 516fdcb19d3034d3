"""The preference manager: named values with defaults; emits "pref-changed"."""
from __future__ import annotations

from typing import Any

from ostrelbase import destroyable


class CPreferenceManager(destroyable.CDestroyable):
    def __init__(self, initial: dict[str, Any] | None = None) -> None:
        super().__init__(('pref-changed',))
        self._fValues: dict[str, Any] = dict(initial or {})

    def GetPref(self, name: str, default: Any = None) -> Any:
        return self._fValues.get(name, default)

    def SetPref(self, name: str, value: Any) -> None:
        if self._fValues.get(name, object()) != value:
            self._fValues[name] = value
            self.emit('pref-changed', self, name, value)
