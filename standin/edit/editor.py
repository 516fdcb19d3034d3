"""Documents of the editor and the GUI manager that tracks them.

``CSourceEditor`` edits one file through its buffer (``fCache``, a ``CTextCache``).
``CGuiManager`` keeps the open documents, which of them are visible and which is
active; it emits "active-document-changed" (manager, document or None).
"""
from __future__ import annotations

from typing import Any

import singleton
from ostrelbase import destroyable


class CDocument:
    """Base of the editor's documents."""

    fIsHelp = False

    def __init__(self) -> None:
        self.fVisible = True

    def GetLocation(self) -> Any:
        return None


class CSourceEditor(CDocument):
    """A source file open for editing."""

    def __init__(self, text_cache: Any) -> None:
        super().__init__()
        self.fCache = text_cache
        self.fCaretLineno = -1

    def GetLocation(self) -> Any:
        return self.fCache.fLocation

    def SetCaretLine(self, lineno: int) -> None:
        """Move the caret; the file's analysis hears of it when one exists."""
        self.fCaretLineno = lineno
        cache_mgr = singleton.GetSingletons().fCacheMgr
        ana = cache_mgr.GetAnalysis(self.fCache.fLocation, False) if cache_mgr else None
        if ana is not None:
            ana.SetActiveEditLineno(lineno)

    def __repr__(self) -> str:
        return f'<CSourceEditor {self.fCache.fLocation!r}>'


class CHelpDocument(CDocument):
    """A documentation page (not a source file)."""

    fIsHelp = True

    def __init__(self, title: str, loc: Any = None) -> None:
        super().__init__()
        self.fTitle = title
        self.fLocation = loc

    def GetLocation(self) -> Any:
        return self.fLocation


class CGuiManager(destroyable.CDestroyable):
    def __init__(self) -> None:
        super().__init__(('active-document-changed', 'document-opened', 'document-closed'))
        self._fDocuments: list[CDocument] = []
        self._fActive: CDocument | None = None

    def OpenDocument(self, loc: Any, visible: bool = True, activate: bool = True
                     ) -> CSourceEditor:
        """Open (or return) the source editor of ``loc``."""
        for doc in self._fDocuments:
            if isinstance(doc, CSourceEditor) and doc.GetLocation() == loc:
                doc.fVisible = doc.fVisible or visible
                break
        else:
            buf = singleton.GetSingletons().fCacheMgr.OpenBuffer(loc)
            doc = CSourceEditor(buf)
            doc.fVisible = visible
            self._fDocuments.append(doc)
            self.emit('document-opened', self, doc)
        if activate:
            self.SetActiveDocument(doc)
        return doc

    def AddDocument(self, doc: CDocument) -> None:
        self._fDocuments.append(doc)
        self.emit('document-opened', self, doc)

    def CloseDocument(self, doc: CDocument) -> None:
        if doc not in self._fDocuments:
            return
        self._fDocuments.remove(doc)
        if doc is self._fActive:
            self.SetActiveDocument(None)
        self.emit('document-closed', self, doc)
        if isinstance(doc, CSourceEditor):
            loc = doc.GetLocation()
            still_open = any(isinstance(d, CSourceEditor) and d.GetLocation() == loc
                             for d in self._fDocuments)
            if not still_open:
                singleton.GetSingletons().fCacheMgr.CloseBuffer(loc)

    def SetActiveDocument(self, doc: CDocument | None) -> None:
        if doc is not self._fActive:
            self._fActive = doc
            self.emit('active-document-changed', self, doc)

    def SetVisible(self, doc: CDocument, visible: bool) -> None:
        doc.fVisible = visible

    def GetActiveDocument(self) -> CDocument | None:
        return self._fActive

    def GetDocuments(self, visible_only: bool = True, include_help: bool = False) -> list[Any]:
        """The locations of the (visible) documents, in the order they were opened."""
        result = []
        for doc in self._fDocuments:
            if visible_only and not doc.fVisible:
                continue
            if doc.fIsHelp and not include_help:
                continue
            loc = doc.GetLocation()
            if loc is not None and loc not in result:
                result.append(loc)
        return result
