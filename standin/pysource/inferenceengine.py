"""The inference engine: scope information on demand, within a deadline.

``GetScopeInfo(loc, scope_name, ctx)`` answers from the information cache and,
when the cache has nothing, scans the scope synchronously (or, for an instance
scope, builds it from its class and methods) as long as the context's deadline
has not passed.
"""
from __future__ import annotations

import time
from typing import Any

from pysource import symbolinfo


class CInferenceContext:
    """The deadline of one inference request."""

    def __init__(self, end_time: float) -> None:
        self.fEndTime = float(end_time)
        self.fScansRun = 0

    def OutOfTime(self) -> bool:
        return time.time() >= self.fEndTime


class CInferenceEngine:
    def __init__(self, ana_mgr: Any) -> None:
        self.fAnaMgr = ana_mgr

    def NewContext(self, end_time: float) -> CInferenceContext:
        return CInferenceContext(end_time)

    def GetScopeInfo(self, loc: Any, scope_name: str, ctx: CInferenceContext) -> Any:
        """The scope's information, scanning it now if needed; None when it cannot be
        had before the deadline (or the file's data is not available yet)."""
        from pysource import scopescanner
        info_cache = self.fAnaMgr.fInfoCache
        info = info_cache.GetScopeInfo(loc, scope_name)
        if info is not None or ctx.OutOfTime():
            return info
        if symbolinfo.IsInstanceScope(scope_name):
            return self._BuildInstanceScope(loc, scope_name, ctx)
        scanner = scopescanner.CSingleScopePrimaryScanner(loc, scope_name, ana_mgr=self.fAnaMgr)
        try:
            ctx.fScansRun += 1
            state = scanner.Scan(ctx.fEndTime)
            if state != scopescanner.kFinishedScanning:
                return None
            scanner.SaveToInfoCache()
            return scanner.fInfo
        finally:
            scanner.destroy()

    def _BuildInstanceScope(self, loc: Any, scope_name: str, ctx: CInferenceContext) -> Any:
        from pysource import scopescanner
        class_info = self.GetScopeInfo(loc, symbolinfo.GetClassForInstanceName(scope_name), ctx)
        if class_info is None or class_info.does_not_exist:
            return None
        methods = []
        for value in class_info.type_equivs.values():
            definfo = symbolinfo.FindDefInfo(value, symbolinfo.kUnboundMethodPrefix)
            if definfo is not None:
                method = self.GetScopeInfo(loc, definfo.scope_name, ctx)
                if method is not None:
                    methods.append(method)
        return scopescanner.CreateClassInstInfo(class_info, methods,
                                                self.fAnaMgr.fPrimaryScanName)

    def InferName(self, loc: Any, scope_name: str, name: str, ctx: CInferenceContext) -> str:
        """A description of what ``name`` resolves to in the scope (see ``inferencer``)."""
        from pysource import inferencer
        self.GetScopeInfo(loc, scope_name, ctx)
        return inferencer.CInferencer(self.fAnaMgr).ResolveName(loc, scope_name, name, 0, set())
