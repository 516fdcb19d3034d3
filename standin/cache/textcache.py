"""Text buffers of files open in the application.

``CTextCache`` holds the text of one file.  Changing the text marks it modified
and emits "text-modified" (text cache); saving writes a local file back and
records the file's new modification time.  Listeners may follow every buffer at
once with ``CTextCache.class_connect_while_alive``.
"""
from __future__ import annotations

import os
from typing import Any

from ostrelbase import destroyable, location

from pysource import strutils


class CTextCache(destroyable.CDestroyable):
    kSignals = ('text-modified', 'saved', 'reverted')

    def __init__(self, loc: Any, text: str = '', mtime: float = 0.0) -> None:
        super().__init__(self.kSignals)
        self.fLocation = loc
        self.fText = strutils.NormalizeEOLs(text)
        self.fModified = False
        self.fLastKnownModTime = float(mtime)

    @classmethod
    def LoadFrom(cls, loc: Any) -> CTextCache:
        """A buffer with the file's current contents (empty for a new file)."""
        if loc.Exists():
            return cls(loc, strutils.DecodeSource(loc.ReadBytes()), loc.GetMTime())
        return cls(loc, '', 0.0)

    def GetText(self) -> str:
        return self.fText

    def SetText(self, text: str) -> None:
        text = strutils.NormalizeEOLs(text)
        if text == self.fText:
            return
        self.fText = text
        self.fModified = True
        self.emit('text-modified', self)

    def IsModified(self) -> bool:
        return self.fModified

    def _GetLastKnownModTime(self) -> float:
        """The file's modification time when it was last loaded or saved."""
        return self.fLastKnownModTime

    def Save(self) -> None:
        """Write a local file back (remote files are read-only in this application)."""
        if not isinstance(self.fLocation, location.CLocalFileLocation):
            raise OSError(f'cannot save {self.fLocation!r}')
        path = self.fLocation.fPath
        with open(path, 'w', encoding='utf-8', newline='\n') as f:
            f.write(self.fText)
        self.fModified = False
        self.fLastKnownModTime = os.stat(path).st_mtime
        self.emit('saved', self)

    def Revert(self) -> None:
        """Reload from the file, dropping unsaved changes."""
        fresh = strutils.DecodeSource(self.fLocation.ReadBytes()) \
            if self.fLocation.Exists() else ''
        changed = strutils.NormalizeEOLs(fresh) != self.fText
        self.fText = strutils.NormalizeEOLs(fresh)
        self.fModified = False
        self.fLastKnownModTime = self.fLocation.GetMTime()
        self.emit('reverted', self)
        if changed:
            self.emit('text-modified', self)
