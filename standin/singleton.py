"""The application's singletons: one object holding the application-wide managers."""
from __future__ import annotations

from typing import Any

from ostrelbase import destroyable

kSingletonNames = ('fPrefMgr', 'fCacheMgr', 'fSavableMgr', 'fFileAttribMgr', 'fGuiMgr',
                   'fAnalysisMgr')


class CApplicationSingletons(destroyable.CDestroyable):
    """Holds the managers; emits "changed" (singletons, attribute name) when one is set."""

    def __init__(self) -> None:
        super().__init__(('changed',))
        self.fPrefMgr: Any = None
        self.fCacheMgr: Any = None
        self.fSavableMgr: Any = None
        self.fFileAttribMgr: Any = None
        self.fGuiMgr: Any = None
        self.fAnalysisMgr: Any = None

    def Set(self, name: str, obj: Any) -> None:
        if name not in kSingletonNames:
            raise AttributeError(f'unknown singleton {name!r}')
        setattr(self, name, obj)
        self.emit('changed', self, name)


_gSingletons: CApplicationSingletons | None = None


def GetSingletons() -> CApplicationSingletons:
    """The application's singletons object (created on first use)."""
    global _gSingletons
    if _gSingletons is None:
        _gSingletons = CApplicationSingletons()
    return _gSingletons


def SetSingleton(name: str, obj: Any) -> None:
    """Set one manager (``name`` is an attribute such as 'fGuiMgr'); emits "changed"."""
    GetSingletons().Set(name, obj)


def ResetSingletons() -> None:
    """For tests: destroy the singletons object; the next GetSingletons makes a new one."""
    global _gSingletons
    old, _gSingletons = _gSingletons, None
    if old is not None:
        old.destroy()
