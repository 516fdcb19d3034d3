"""Analysis of one Python file open in the application.

``CPySourceAnalysis`` knows the scopes of its file (from the information cache,
or from a quick parse of the current source when nothing is cached yet) so the
editor can ask which scope holds a line.  It emits "modified" (analysis) when
its file's text changed and "active-edit-lineno-changed" (analysis, line number
or -1) when the caret moves to another line.  Both are also followed
class-wide, through ``CPySourceAnalysis.class_connect_while_alive``.
"""
from __future__ import annotations

import bisect
from typing import Any

import singleton
from ostrelbase import destroyable

from pysource import symbolinfo


class CPySourceAnalysis(destroyable.CDestroyable):
    kSignals = ('modified', 'active-edit-lineno-changed')

    def __init__(self, loc: Any, ana_mgr: Any = None) -> None:
        super().__init__(self.kSignals)
        self.fLocation = loc
        self.fAnaMgr = ana_mgr
        self.fActiveEditLineno = -1
        # (first line, -last line, scope name), sorted: the innermost scope of a
        # line is the last range starting at or before it that still contains it.
        self._fRanges: list[tuple[int, int, str]] = []
        self.UpdateFromCache()

    def _GetAnaMgr(self) -> Any:
        return self.fAnaMgr if self.fAnaMgr is not None else \
            singleton.GetSingletons().fAnalysisMgr

    def UpdateFromCache(self) -> None:
        """Refresh the scope table from the information cache (or the source)."""
        ranges: list[tuple[int, int, str]] = []
        ana_mgr = self._GetAnaMgr()
        infos = ana_mgr.fInfoCache.GetScopeInfos(self.fLocation) if ana_mgr else {}
        if infos:
            for name, info in infos.items():
                definfo = info.GetDefInfo() if not info.does_not_exist else None
                if definfo is not None and not symbolinfo.IsInstanceScope(name):
                    ranges.append((definfo.lineno, -definfo.end_lineno, name))
        else:
            ranges = self._RangesFromSource()
        ranges.sort()
        self._fRanges = ranges

    def _RangesFromSource(self) -> list[tuple[int, int, str]]:
        from pysource import scopescanner
        cache_mgr = singleton.GetSingletons().fCacheMgr
        source = cache_mgr.GetSourceForScan(self.fLocation) if cache_mgr else None
        if source is None:
            return []
        tree, patched, failed = scopescanner.ParseTolerant(source[0])
        result = []
        for rec in scopescanner.CollectScopes(tree, patched, failed)[1:]:
            first, last = rec.LineRange()
            result.append((first, -last, rec.fName))
        return result

    def FindScopeContainingLine(self, lineno: int) -> str:
        """The innermost scope holding ``lineno`` ('' for module level)."""
        i = bisect.bisect_right(self._fRanges, (lineno, 1, ''))
        while i > 0:
            i -= 1
            first, neg_last, name = self._fRanges[i]
            if first <= lineno <= -neg_last:
                return name
        return symbolinfo.kModuleScope

    def GetScopeNames(self) -> list[str]:
        return [name for _first, _last, name in self._fRanges]

    def SetActiveEditLineno(self, lineno: int) -> None:
        """The caret moved to ``lineno`` (-1: no caret in this file)."""
        if lineno != self.fActiveEditLineno:
            self.fActiveEditLineno = lineno
            self.emit('active-edit-lineno-changed', self, lineno)

    def NotifyModified(self) -> None:
        self.emit('modified', self)
