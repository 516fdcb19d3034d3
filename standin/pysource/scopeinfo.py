"""The information cache: scope information of scanned files, in memory and on disk.

Design note
-----------
``CInfoCache`` holds, per location:

- ``_fInfos[loc][scope_name]``: the ``CScopeInfo`` built by the primary scan of
  that scope (names mapped to equivalents, see ``symbolinfo``);
- ``_fDerived[loc][scope_name]``: the derived information of the secondary scan
  (name -> description of what it resolves to);
- ``_fScansDone[loc][scan_name]``: the file modification time for which that scan
  covered the whole file.  ``GetScansDoneForMultipleFiles`` answers with the scan
  names whose recorded time equals the time asked about, so a changed file counts
  as not scanned;
- ``_fDependents[loc]``: files whose derived information used ``loc``; when a
  whole-file save changes ``loc`` they are reported as needing a derived rescan.

Every change marks the location dirty; ``WriteToDatabase`` writes dirty files to
a sqlite database (when one is configured) and ``LoadFromDatabase`` reads it
back, so a later session knows which files are up to date.

Parse trees of files being scanned are shared between scanners through
``GetParsedSource`` (an LRU of ``kMaxParseTrees``); ``FinishedWithScans`` and
``Trim`` release them.

The cache emits "needs-scan-added" (cache, list of (loc, scope, scan name),
priority or None) when stored information makes other information stale.
"""
from __future__ import annotations

import collections
import json
import os
import sqlite3
from collections.abc import Iterable
from typing import Any, NamedTuple

from ostrelbase import destroyable, location

from pysource import symbolinfo

kMaxParseTrees = 16


class CScopeInfoKey(NamedTuple):
    """Which information this is: for (loc, scope_name) by ``scan_name``, defined
    at (def_loc, def_scope_name) (different for an instance scope, defined by its
    class)."""

    loc: Any
    scope_name: str
    scan_name: str
    def_loc: Any
    def_scope_name: str


class CScopeInfo:
    """The primary information of one scope.

    ``def_info`` is the packed definition info of the scope's class or def (empty
    for the module scope), ``disk_mtime`` the file time it was built from,
    ``incomplete`` whether the source had errors in the scope, ``does_not_exist``
    whether the scope is known not to exist, ``type_equivs`` name -> equivalents.
    """

    __slots__ = (
        'def_info',
        'disk_mtime',
        'does_not_exist',
        'incomplete',
        'key',
        'type_equivs',
    )

    def __init__(self, key: CScopeInfoKey, def_info: bytes | str, disk_mtime: float,
                 incomplete: bool = False, does_not_exist: bool = False,
                 type_equivs: dict[str, bytes] | None = None) -> None:
        self.key = key
        self.def_info = def_info.encode('utf-8') if isinstance(def_info, str) else def_info
        self.disk_mtime = disk_mtime
        self.incomplete = bool(incomplete)
        self.does_not_exist = bool(does_not_exist)
        self.type_equivs: dict[str, bytes] = dict(type_equivs or {})

    @property
    def loc(self) -> Any:
        return self.key.loc

    @property
    def scope_name(self) -> str:
        return self.key.scope_name

    def GetDefInfo(self) -> symbolinfo.CDefInfo | None:
        return symbolinfo.UnpackDefInfoStr(self.def_info) if self.def_info else None

    def SameContent(self, other: CScopeInfo | None) -> bool:
        """Equal apart from the file time (which changes on every save)."""
        return (other is not None and self.key == other.key
                and self.def_info == other.def_info
                and self.incomplete == other.incomplete
                and self.does_not_exist == other.does_not_exist
                and self.type_equivs == other.type_equivs)

    def __repr__(self) -> str:
        flags = ' missing' if self.does_not_exist else ''
        flags += ' incomplete' if self.incomplete else ''
        return (f'<CScopeInfo {self.key.scope_name!r} of {self.key.loc!r}{flags}: '
                f'{len(self.type_equivs)} names>')


class CLocCache:
    """What the engine wants to know about locations.

    Derived information is wanted for files under the project directories (for
    every file when no project directory is given); library files get only the
    primary scan.
    """

    def __init__(self, project_dirs: Iterable[Any] = ()) -> None:
        self.fProjectDirs = [d for d in project_dirs]
        self.fBuiltinLoc: Any = None

    def GetBuiltinLoc(self) -> Any:
        """The location of the builtins module (None until it is known)."""
        return self.fBuiltinLoc

    def WantDerivedInfo(self, loc: Any) -> bool:
        if not self.fProjectDirs:
            return True
        url = getattr(loc, 'fUrl', '')
        return any(url == d.fUrl or url.startswith(d.fUrl.rstrip('/') + '/')
                   for d in self.fProjectDirs)


class CParsedSource(NamedTuple):
    """A parse shared by the scanners of one file."""

    text: str
    mtime: float
    tree: Any
    patched_lines: frozenset[int]
    parse_failed: bool


class CInfoCache(destroyable.CDestroyable):
    """Scope information of scanned files; see the module note."""

    def __init__(self, primary_scan_name: str, derived_scan_name: str,
                 db_path: str | None = None, loc_cache: CLocCache | None = None) -> None:
        super().__init__(('needs-scan-added',))
        self.fPrimaryScanName = primary_scan_name
        self.fDerivedScanName = derived_scan_name
        self.fDatabasePath = db_path
        self.fLocCache = loc_cache if loc_cache is not None else CLocCache()
        self._fInfos: dict[Any, dict[str, CScopeInfo]] = {}
        self._fDerived: dict[Any, dict[str, dict[str, str]]] = {}
        self._fScansDone: dict[Any, dict[str, float]] = {}
        self._fDependents: dict[Any, set[Any]] = collections.defaultdict(set)
        self._fDirty: set[Any] = set()
        self._fParseTrees: collections.OrderedDict[Any, CParsedSource] = \
            collections.OrderedDict()
        self.fFinishedScanCount = 0

    # -- reading -----------------------------------------------------------------

    def GetScopeInfo(self, loc: Any, scope_name: str) -> CScopeInfo | None:
        return self._fInfos.get(loc, {}).get(scope_name)

    def GetScopeInfos(self, loc: Any) -> dict[str, CScopeInfo]:
        """A copy of every scope's information of ``loc``."""
        return dict(self._fInfos.get(loc, {}))

    def GetDerivedInfo(self, loc: Any, scope_name: str) -> dict[str, str] | None:
        return self._fDerived.get(loc, {}).get(scope_name)

    def GetKnownLocations(self) -> list[Any]:
        return list(self._fInfos)

    def GetAllImports(self, loc_list: Iterable[Any]) -> list[tuple[Any, str, bytes]]:
        """(loc, scope name, import equivalent) for every import recorded in the files."""
        result = []
        for loc in loc_list:
            for scope_name, info in self._fInfos.get(loc, {}).items():
                for value in info.type_equivs.values():
                    for eq in symbolinfo.NonNestedSplit(value, symbolinfo.kEquivSeparator):
                        if eq.startswith((symbolinfo.kImportPrefix,
                                          symbolinfo.kFromImportPrefix)):
                            result.append((loc, scope_name, eq))
        return result

    def GetScansDoneForMultipleFiles(self, mtime_dict: dict[Any, float]) -> dict[Any, str]:
        """loc -> space-separated names of the scans done for the file at that time."""
        result = {}
        for loc, mtime in mtime_dict.items():
            done = self._fScansDone.get(loc, {})
            result[loc] = ' '.join(name for name, t in done.items() if t == mtime)
        return result

    def GetDiskMTime(self, loc: Any) -> float:
        """The file's modification time on disk; 0.0 when it does not exist."""
        return float(loc.GetMTime())

    # -- storing -----------------------------------------------------------------

    def AddScopeInfo(self, info: CScopeInfo) -> bool:
        """Store information built without scanning; returns whether it changed."""
        return self._Store(info)

    def StoreScopeInfo(self, info: CScopeInfo, notify: bool = True) -> bool:
        """Store one scope's primary information.

        When it changed, the file's derived scan is no longer current; with
        ``notify`` the derived rescan of the scope is reported through
        "needs-scan-added".  Returns whether the information changed.
        """
        changed = self._Store(info)
        if changed:
            loc = info.key.loc
            self._fScansDone.get(loc, {}).pop(self.fDerivedScanName, None)
            if notify and self.fLocCache.WantDerivedInfo(loc):
                self.NoteNeedsScan([(loc, info.key.scope_name, self.fDerivedScanName)])
        return changed

    def RemoveScopeInfo(self, loc: Any, scope_name: str) -> bool:
        infos = self._fInfos.get(loc)
        if not infos or scope_name not in infos:
            return False
        del infos[scope_name]
        self._fDirty.add(loc)
        return True

    def ReplaceFileInfos(self, loc: Any, infos: dict[str, CScopeInfo], scan_name: str,
                         mtime: float | None) -> set[str]:
        """Replace every scope of ``loc`` by the result of a whole-file scan.

        Records the scan as done for ``mtime`` (not when None: the source was an
        unsaved buffer).  Returns the names of the scopes that changed, appeared
        or disappeared; files that depend on ``loc`` are reported as needing a
        derived rescan when anything changed.
        """
        old = self._fInfos.get(loc, {})
        changed = {name for name, info in infos.items() if not info.SameContent(old.get(name))}
        changed.update(set(old) - set(infos))
        self._fInfos[loc] = dict(infos)
        done = self._fScansDone.setdefault(loc, {})
        if changed:
            done.pop(self.fDerivedScanName, None)
            for name in set(old) - set(infos):
                self._fDerived.get(loc, {}).pop(name, None)
        if mtime is not None and mtime > 0:
            done[scan_name] = mtime
        else:
            done.pop(scan_name, None)
        self._fDirty.add(loc)
        if changed:
            dependents = [d for d in self._fDependents.get(loc, ()) if d != loc]
            triples = [(d, symbolinfo.kWildcardScope, self.fDerivedScanName)
                       for d in sorted(dependents) if self.fLocCache.WantDerivedInfo(d)]
            if triples:
                self.NoteNeedsScan(triples)
        return changed

    def ForgetFile(self, loc: Any) -> None:
        """Drop everything known about ``loc`` (the file is gone)."""
        for table in (self._fInfos, self._fDerived, self._fScansDone):
            table.pop(loc, None)
        self._fParseTrees.pop(loc, None)
        self._fDirty.add(loc)

    def SetDerivedInfo(self, loc: Any, scope_name: str, derived: dict[str, str],
                       dependencies: Iterable[Any] = ()) -> None:
        self._fDerived.setdefault(loc, {})[scope_name] = dict(derived)
        for dep in dependencies:
            self._fDependents[dep].add(loc)
        self._fDirty.add(loc)

    def RecordScanDone(self, loc: Any, scan_name: str, mtime: float | None) -> None:
        if mtime is not None and mtime > 0:
            self._fScansDone.setdefault(loc, {})[scan_name] = mtime
            self._fDirty.add(loc)

    def GetScanDoneTime(self, loc: Any, scan_name: str) -> float | None:
        return self._fScansDone.get(loc, {}).get(scan_name)

    def NoteNeedsScan(self, triples: Iterable[tuple[Any, str, str]],
                      priority: int | None = None) -> None:
        """Report scans that other information now needs."""
        triples = list(triples)
        if triples:
            self.emit('needs-scan-added', self, triples, priority)

    def _Store(self, info: CScopeInfo) -> bool:
        loc = info.key.loc
        infos = self._fInfos.setdefault(loc, {})
        old = infos.get(info.key.scope_name)
        infos[info.key.scope_name] = info
        self._fDirty.add(loc)
        return not info.SameContent(old)

    # -- scan-time data ------------------------------------------------------------

    def GetParsedSource(self, loc: Any, text: str, mtime: float,
                        parse_fn: Any) -> CParsedSource:
        """The shared parse of ``text``; ``parse_fn(text)`` -> (tree, patched, failed)
        runs only when no parse of the same text is cached."""
        cached = self._fParseTrees.get(loc)
        if cached is not None and cached.text == text:
            self._fParseTrees.move_to_end(loc)
            return cached
        tree, patched, failed = parse_fn(text)
        parsed = CParsedSource(text, mtime, tree, frozenset(patched), failed)
        self._fParseTrees[loc] = parsed
        self.Trim()
        return parsed

    def FinishedWithScans(self, loc: Any, scope_name: str | None,
                          scan_name: str | None) -> None:
        """A scan completed: the parse of a file is released after its derived scan."""
        self.fFinishedScanCount += 1
        if scan_name == self.fDerivedScanName and scope_name == symbolinfo.kWildcardScope:
            self._fParseTrees.pop(loc, None)

    def Trim(self) -> None:
        while len(self._fParseTrees) > kMaxParseTrees:
            self._fParseTrees.popitem(last=False)

    def Clear(self) -> None:
        for table in (self._fInfos, self._fDerived, self._fScansDone, self._fDependents,
                      self._fParseTrees):
            table.clear()
        self._fDirty.clear()

    # -- database --------------------------------------------------------------------

    _kSchema = (
        ('CREATE TABLE IF NOT EXISTS scopes (url TEXT, scope TEXT, scan TEXT, def_url TEXT,'
         ' def_scope TEXT, def_info BLOB, mtime REAL, incomplete INTEGER, missing INTEGER,'
         ' equivs TEXT, PRIMARY KEY (url, scope))'),
        ('CREATE TABLE IF NOT EXISTS scans_done (url TEXT, scan TEXT, mtime REAL,'
         ' PRIMARY KEY (url, scan))'),
        ('CREATE TABLE IF NOT EXISTS derived (url TEXT, scope TEXT, info TEXT,'
         ' PRIMARY KEY (url, scope))'),
    )

    def WriteToDatabase(self) -> int | None:
        """Write the files changed since the last write; returns how many, or None
        when no database is configured."""
        if not self.fDatabasePath:
            return None
        dirty = list(self._fDirty)
        if not dirty:
            return 0
        os.makedirs(os.path.dirname(os.path.abspath(self.fDatabasePath)), exist_ok=True)
        with sqlite3.connect(self.fDatabasePath) as db:
            for stmt in self._kSchema:
                db.execute(stmt)
            for loc in dirty:
                self._WriteLoc(db, loc)
        db.close()
        self._fDirty.difference_update(dirty)
        return len(dirty)

    def _WriteLoc(self, db: sqlite3.Connection, loc: Any) -> None:
        url = loc.fUrl
        for table in ('scopes', 'scans_done', 'derived'):
            db.execute(f'DELETE FROM {table} WHERE url = ?', (url,))
        for info in self._fInfos.get(loc, {}).values():
            k = info.key
            equivs = {name: value.decode('utf-8', 'surrogateescape')
                      for name, value in info.type_equivs.items()}
            db.execute('INSERT INTO scopes VALUES (?,?,?,?,?,?,?,?,?,?)',
                       (url, k.scope_name, k.scan_name, k.def_loc.fUrl, k.def_scope_name,
                        info.def_info, info.disk_mtime, int(info.incomplete),
                        int(info.does_not_exist), json.dumps(equivs)))
        for scan, mtime in self._fScansDone.get(loc, {}).items():
            db.execute('INSERT INTO scans_done VALUES (?,?,?)', (url, scan, mtime))
        for scope, derived in self._fDerived.get(loc, {}).items():
            db.execute('INSERT INTO derived VALUES (?,?,?)', (url, scope, json.dumps(derived)))

    def LoadFromDatabase(self) -> int:
        """Read what an earlier session wrote; returns the number of files loaded.
        In-memory information of a file wins over the database's."""
        if not self.fDatabasePath or not os.path.exists(self.fDatabasePath):
            return 0
        with sqlite3.connect(self.fDatabasePath) as db:
            for stmt in self._kSchema:
                db.execute(stmt)
            scopes = db.execute('SELECT * FROM scopes').fetchall()
            scans = db.execute('SELECT * FROM scans_done').fetchall()
            derived = db.execute('SELECT * FROM derived').fetchall()
        db.close()
        loaded: set[Any] = set()
        known = set(self._fInfos) | set(self._fScansDone)
        for (url, scope, scan, def_url, def_scope, def_info, mtime, incomplete, missing,
             equivs) in scopes:
            loc = location.CreateFromName(url)
            if loc in known:
                continue
            key = CScopeInfoKey(loc, scope, scan, location.CreateFromName(def_url), def_scope)
            type_equivs = {name: value.encode('utf-8', 'surrogateescape')
                           for name, value in json.loads(equivs).items()}
            self._fInfos.setdefault(loc, {})[scope] = CScopeInfo(
                key, bytes(def_info), mtime, bool(incomplete), bool(missing), type_equivs)
            loaded.add(loc)
        for url, scan, mtime in scans:
            loc = location.CreateFromName(url)
            if loc not in known:
                self._fScansDone.setdefault(loc, {})[scan] = mtime
                loaded.add(loc)
        for url, scope, info in derived:
            loc = location.CreateFromName(url)
            if loc not in known:
                self._fDerived.setdefault(loc, {})[scope] = json.loads(info)
        return len(loaded)
