"""The analysis manager and its services: module resolution, location data, config.

Design note
-----------
``CAnalysisManager`` owns the analysis engine of one project: the information
cache, the inference engine, the location data cache and the analysis factory.
It names the two scans: ``fPrimaryScanName`` builds scope information from
source, ``fDerivedScanName`` derives further information afterwards.  Neither name
contains the other (the scan coordinator tests scan names as substrings of the
information cache's scans-done strings).

``CAnalysisFactory`` resolves module names to files along the Python path
(``CPyConfig.python_path_locs``), with a per-directory cache (``CModFileCache``)
that emits "suspend" and "unsuspend" around changes of the path; the factory
then emits "import-resolution-changed".  The builtins module has no source, so
the factory serves a stub shipped with the engine (``stubs/builtins.pyi``).

``CLocationDataCache`` tells whether a location and all its parent directories
are inspected ("tree branch ready"); for remote locations it starts the
inspection on request and emits "now-tree-branch-ready" (cache, set of
locations) or "inspect-failed" (cache, set of locations) when it completes.
"""
from __future__ import annotations

import os
import sysconfig
from collections.abc import Iterable
from typing import Any

from ostrelbase import destroyable, location

from pysource import inferenceengine, scopeinfo, symbolinfo

kPrimaryScanName = 'scope-primary'
kDerivedScanName = 'scope-derived'
kStubDir = os.path.join(os.path.dirname(os.path.abspath(__file__)), 'stubs')
kBuiltinModuleName = 'builtins'
kTypingModuleNames = ('typing', 'typing_extensions')
kSourceSuffixes = ('.py', '.pyi')


def StdlibDir() -> str:
    return sysconfig.get_paths()['stdlib']


class CPyConfig:
    """The project's Python configuration."""

    def __init__(self, python_path_locs: Iterable[Any] = ()) -> None:
        self.python_path_locs: list[Any] = list(python_path_locs)


class CBuiltinModRecord:
    """What the factory knows about the builtins module."""

    def __init__(self, local_name: str, loc: Any) -> None:
        self.fLocalName = local_name
        self.fLocation = loc

    def __repr__(self) -> str:
        return f'<CBuiltinModRecord {self.fLocalName!r} at {self.fLocation!r}>'


def _Exists(loc: Any) -> bool:
    """Whether a file exists, without waiting: a remote one is looked up in its
    inspected parent directory's listing."""
    if location.IsAsyncInspectLocation(loc):
        parent = loc.GetParentDir()
        return parent.IsReady() and loc.GetBaseName() in parent.ListDir()
    return loc.Exists()


def _NamesEntries(dotted: str) -> bool:
    """Whether each part of a dotted name is a plain directory entry name (as the
    parts of module names are), so candidates need no path normalising."""
    return not dotted or all(p and p not in ('.', '..') and os.sep not in p
                             for p in dotted.split('.'))


class CModFileCache(destroyable.CDestroyable):
    """Module name lookups per directory: (name, dir url) -> location or None.

    Local directories' listings are cached too (``Listing``), so that looking for
    a module tries its candidate file names against a set instead of asking the
    file system for each; a listed name is still confirmed with ``stat`` (a
    broken link is listed but does not exist).  Both caches are emptied by
    ``Clear`` and ``Suspend``."""

    def __init__(self) -> None:
        super().__init__(('suspend', 'unsuspend'))
        self._fLookups: dict[tuple[str, str], Any] = {}
        self._fListings: dict[str, frozenset[str] | None] = {}
        self._fFound: dict[tuple[str, str, bool], Any] = {}
        self.fSuspendCount = 0

    def Listing(self, path: str) -> frozenset[str] | None:
        """The names in local directory ``path`` (empty when it cannot be listed
        because it is missing or not a directory; None when listing is refused,
        so the caller asks for each name)."""
        listing = self._fListings.get(path, False)
        if listing is False:
            try:
                listing = frozenset(os.listdir(path))
            except (FileNotFoundError, NotADirectoryError):
                listing = frozenset()
            except OSError:
                listing = None
            if self.fSuspendCount == 0:
                self._fListings[path] = listing
        return listing

    def Get(self, name: str, dirloc: Any) -> tuple[bool, Any]:
        key = (name, dirloc.fUrl)
        if key in self._fLookups:
            return True, self._fLookups[key]
        return False, None

    def Put(self, name: str, dirloc: Any, loc: Any) -> None:
        if self.fSuspendCount == 0:
            self._fLookups[(name, dirloc.fUrl)] = loc

    def Clear(self) -> None:
        self._fLookups.clear()
        self._fListings.clear()
        self._fFound.clear()

    def Suspend(self) -> None:
        """Stop caching (the file system or the path is changing)."""
        self.fSuspendCount += 1
        if self.fSuspendCount == 1:
            self.Clear()
            self.emit('suspend', self)

    def Unsuspend(self) -> None:
        if self.fSuspendCount <= 0:
            raise RuntimeError('Unsuspend without Suspend')
        self.fSuspendCount -= 1
        if self.fSuspendCount == 0:
            self.emit('unsuspend', self)


class CAnalysisFactory(destroyable.CDestroyable):
    """Finds the files of modules."""

    def __init__(self, py_config: CPyConfig, stub_dir: str = kStubDir) -> None:
        super().__init__(('import-resolution-changed',))
        self.fPyConfig = py_config
        self.fStubDir = location.CLocalFileLocation(stub_dir)
        self._fModFileCache = CModFileCache()

    def _destroy_impl(self) -> None:
        self._fModFileCache.destroy()

    def SetPythonPath(self, locs: Iterable[Any]) -> None:
        """Change the Python path; module lookups are redone afterwards."""
        self._fModFileCache.Suspend()
        try:
            self.fPyConfig.python_path_locs = list(locs)
        finally:
            self._fModFileCache.Unsuspend()
        self.emit('import-resolution-changed', self)

    def FindBuiltinMod(self) -> CBuiltinModRecord | None:
        locs = self.GetAllLocsForName(kBuiltinModuleName)
        return CBuiltinModRecord(kBuiltinModuleName, locs[0]) if locs else None

    def GetAllLocsForName(self, name: str, dirloc: Any = None,
                          include_extensions: bool = False) -> list[Any]:
        """Every file that may define module ``name`` (source before stub)."""
        if name == kBuiltinModuleName:
            stub = self.fStubDir.Join('builtins.pyi')
            return [stub] if stub.Exists() else []
        result = []
        for base in self._SearchDirs(dirloc):
            for candidate in self._Candidates(base, name, include_extensions):
                if candidate not in result and _Exists(candidate):
                    result.append(candidate)
        return result

    def GetTypingLocations(self) -> list[Any]:
        locs = []
        for name in kTypingModuleNames:
            found = self.FindModuleLoc(name)
            if found is not None:
                locs.append(found)
        return locs

    def GetSecondaryLocations(self, loc: Any) -> list[Any] | None:
        """The stub next to a source file (scanned after it), if there is one."""
        url = loc.fUrl
        if not url.endswith('.py'):
            return None
        stub = location.CreateFromName(url + 'i')
        return [stub] if _Exists(stub) else None

    def _FindPrimaryLocsForNames(self, names: Iterable[str], dirloc: Any,
                                 include_extensions: bool = False) -> list[Any]:
        """The file of each module name (sorted by name), None where there is none."""
        return [self.FindModuleLoc(name, dirloc, include_extensions) for name in sorted(names)]

    def FindModuleLoc(self, name: str, dirloc: Any = None,
                      include_extensions: bool = False) -> Any:
        """The file of module ``name`` as imported from a file in ``dirloc``.

        A name with leading dots is relative to ``dirloc``; others are looked up
        in ``dirloc`` first (the importing script's directory), then along the path.
        """
        if not name:
            return None
        cache = self._fModFileCache
        cache_dir = dirloc if dirloc is not None else self.fStubDir
        hit, found = cache.Get(name, cache_dir)
        if hit:
            return found
        if name == kBuiltinModuleName:
            locs = self.GetAllLocsForName(name)
            found = locs[0] if locs else None
        else:
            found = self._Search(name, dirloc, include_extensions)
        cache.Put(name, cache_dir, found)
        return found

    def _Search(self, name: str, dirloc: Any, include_extensions: bool) -> Any:
        rel = name.lstrip('.')
        if rel != name:
            if dirloc is None:
                return None
            base = dirloc
            for _up in range(len(name) - len(rel) - 1):
                base = base.GetParentDir()
            bases = [base]
        else:
            bases = self._SearchDirs(dirloc)
        for base in bases:
            found = self._FindIn(base, rel, include_extensions)
            if found is not None:
                return found
        return None

    def _FindIn(self, base: Any, dotted: str, include_extensions: bool) -> Any:
        """The first of ``_Candidates(base, dotted)`` that exists, or None."""
        if isinstance(base, location.CLocalFileLocation):
            cache = self._fModFileCache
            key = (base.fPath, dotted, include_extensions)
            found = cache._fFound.get(key, False)
            if found is not False:
                return found
            if _NamesEntries(dotted):
                found = self._FindInLocalDir(base.fPath, dotted, include_extensions)
                if cache.fSuspendCount == 0:
                    cache._fFound[key] = found
                return found
        for candidate in self._Candidates(base, dotted, include_extensions):
            if _Exists(candidate):
                return candidate
        return None

    def _FindInLocalDir(self, base: str, dotted: str, include_extensions: bool) -> Any:
        """``_FindIn`` for a local directory, with its candidates tried against
        directory listings: the same candidates in the same order."""
        listing = self._fModFileCache.Listing
        if dotted:
            parts = dotted.split('.')
            parent = os.path.join(base, *parts[:-1])
            leaf = parts[-1]
            candidates = [(parent, leaf + suffix) for suffix in kSourceSuffixes]
            parent_names = listing(parent)
            if parent_names is None or leaf in parent_names:  # else no package dir
                pkg = os.path.join(parent, leaf)
                candidates += [(pkg, '__init__' + suffix) for suffix in kSourceSuffixes]
            if include_extensions:
                candidates.append((parent, leaf + '.so'))
        else:
            candidates = [(base, '__init__' + suffix) for suffix in kSourceSuffixes]
        for directory, name in candidates:
            names = listing(directory)
            if names is not None and name not in names:
                continue
            path = os.path.join(directory, name)
            try:
                os.stat(path)
            except OSError:
                continue
            return location.CLocalFileLocation._FromNormalPath(path)
        return None

    def _SearchDirs(self, dirloc: Any) -> list[Any]:
        dirs = [] if dirloc is None else [dirloc]
        for d in self.fPyConfig.python_path_locs:
            if d not in dirs:
                dirs.append(d)
        return dirs

    @staticmethod
    def _Candidates(base: Any, dotted: str, include_extensions: bool) -> list[Any]:
        if not dotted:
            return [base.Join('__init__' + suffix) for suffix in kSourceSuffixes]
        parts = dotted.split('.')
        if not all(parts):
            return []
        pkg = base.Join(*parts)
        parent = base.Join(*parts[:-1]) if len(parts) > 1 else base
        leaf = parts[-1]
        result = [parent.Join(leaf + suffix) for suffix in kSourceSuffixes]
        result += [pkg.Join('__init__' + suffix) for suffix in kSourceSuffixes]
        if include_extensions:
            result.append(parent.Join(leaf + '.so'))
        return result


class CLocationDataCache(destroyable.CDestroyable):
    """Which locations have their data (and their directories') available."""

    def __init__(self) -> None:
        super().__init__(('now-tree-branch-ready', 'inspect-failed', 'cleared'))
        self._fRequested: set[Any] = set()
        self._fGeneration = 0

    @staticmethod
    def _Branch(loc: Any) -> list[Any]:
        branch = [loc]
        while True:
            parent = branch[-1].GetParentDir()
            if parent == branch[-1]:
                return branch
            branch.append(parent)

    def TreeBranchReady(self, loc: Any, start_inspect: bool = True) -> bool:
        """Whether ``loc`` and its parent directories are inspected; if not and
        ``start_inspect``, start inspecting them (signals tell the outcome)."""
        if not location.IsAsyncInspectLocation(loc):
            return True
        unready = [b for b in self._Branch(loc) if not b.IsReady()]
        if not unready:
            return True
        if start_inspect and loc not in self._fRequested:
            self._fRequested.add(loc)
            generation = self._fGeneration

            def done(abort: bool) -> None:
                if generation != self._fGeneration:
                    return
                self._fRequested.discard(loc)
                if abort:
                    self.emit('inspect-failed', self, {loc})
                elif all(b.IsReady() for b in self._Branch(loc)):
                    self.emit('now-tree-branch-ready', self, {loc})
            location._WaitForInspectMultiple(unready, done, False)
        return False

    def Clear(self) -> None:
        """Forget the requests in flight (their outcome is no longer reported)."""
        self._fRequested.clear()
        self._fGeneration += 1
        self.emit('cleared', self)


class CAnalysisManager(destroyable.CDestroyable):
    """The analysis engine of one project (see the module note)."""

    def __init__(self, python_path_locs: Iterable[Any], project_dirs: Iterable[Any] = (),
                 db_path: str | None = None) -> None:
        super().__init__(())
        self.fPrimaryScanName = kPrimaryScanName
        self.fDerivedScanName = kDerivedScanName
        self.fPyConfig = CPyConfig(python_path_locs)
        self.fLocCache = scopeinfo.CLocCache(project_dirs)
        self.fInfoCache = scopeinfo.CInfoCache(self.fPrimaryScanName, self.fDerivedScanName,
                                               db_path, self.fLocCache)
        self.fLocationDataCache = CLocationDataCache()
        self.fAnalysisFactory = CAnalysisFactory(self.fPyConfig)
        self.fInferenceEngine = inferenceengine.CInferenceEngine(self)
        self.fHelperProcessProxy: Any = None
        self._fHelperProcessSupport: Any = None
        self.fScanCoordinator: Any = None
        builtin = self.fAnalysisFactory.FindBuiltinMod()
        self.fLocCache.fBuiltinLoc = builtin.fLocation if builtin is not None else None

    def GetScopeInfo(self, loc: Any, scope_name: str = symbolinfo.kModuleScope) -> Any:
        return self.fInfoCache.GetScopeInfo(loc, scope_name)

    def _destroy_impl(self) -> None:
        if self.fScanCoordinator is not None:
            self.fScanCoordinator.destroy()
            self.fScanCoordinator = None
        for obj in (self.fAnalysisFactory, self.fLocationDataCache, self.fInfoCache):
            obj.destroy()
