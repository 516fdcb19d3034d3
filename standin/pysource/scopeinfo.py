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
- ``_fDependents[loc]``: files whose derived information used ``loc`` (and
  ``_fDepsOf[loc]``, the other way round); when a whole-file save changes ``loc``
  they are reported as needing a derived rescan.

Every change marks the location dirty; ``WriteToDatabase`` writes dirty files to
a sqlite database (``infodb``) in one transaction.  ``LoadFromDatabase`` reads
only the database's index of files: which scans are done for which modification
time, which is all a session needs to skip unchanged files.  A stored file's
scopes, derived information and dependencies are read when the file is first
asked about or changed (``_Read``; ``_fUnread`` holds the URLs not read yet),
and the whole-file check's ``GetAllImports`` answers unread files from the
database's import index.  Every answer is the same as if everything had been
read at start.

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
from collections.abc import Iterable
from typing import Any, NamedTuple

from ostrelbase import destroyable, location

from pysource import infodb, symbolinfo

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
        self._fDepsOf: dict[Any, set[Any]] = {}
        self._fDirty: set[Any] = set()
        self._fParseTrees: collections.OrderedDict[Any, CParsedSource] = \
            collections.OrderedDict()
        self.fFinishedScanCount = 0
        # scan name -> [whole-file scans, single-scope scans] completed
        self.fFinishedScans: dict[str, list[int]] = {}
        self.fLastFinished: Any = None
        # The database side (see infodb): the stored files' index by URL, the URLs
        # whose contents are not read yet, and who depends on whom (built on use).
        self._fDatabase: infodb.CInfoDatabase | None = None
        self._fStored: dict[str, tuple[int, dict[str, float], int]] = {}
        self._fIds: dict[str, int] = {}
        self._fUnread: set[str] = set()
        self._fStoredDependents: dict[str, set[str]] | None = None
        self._fUrlsById: dict[int, str] | None = None
        self.fDatabaseError: str | None = None
        self.fLastWriteCount = 0

    def _destroy_impl(self) -> None:
        if self._fDatabase is not None:
            self._fDatabase.Close()
            self._fDatabase = None

    # -- reading -----------------------------------------------------------------

    def GetScopeInfo(self, loc: Any, scope_name: str) -> CScopeInfo | None:
        infos = self._fInfos.get(loc)
        if infos is None:
            if not self._fUnread or getattr(loc, 'fUrl', None) not in self._fUnread:
                return None
            infos = self._Read(loc)
        return infos.get(scope_name)

    def GetScopeInfos(self, loc: Any) -> dict[str, CScopeInfo]:
        """A copy of every scope's information of ``loc``."""
        self._ReadIfStored(loc)
        return dict(self._fInfos.get(loc, {}))

    def GetDerivedInfo(self, loc: Any, scope_name: str) -> dict[str, str] | None:
        self._ReadIfStored(loc)
        return self._fDerived.get(loc, {}).get(scope_name)

    def GetKnownLocations(self) -> list[Any]:
        """Files with scope information, in memory or in the database."""
        known = list(self._fInfos)
        seen = {loc.fUrl for loc in known}
        known.extend(location.CreateFromName(url) for url, (_id, _s, n) in self._fStored.items()
                     if n and url not in seen and url in self._fUnread)
        return known

    def GetAllImports(self, loc_list: Iterable[Any]) -> list[tuple[Any, str, bytes]]:
        """(loc, scope name, import equivalent) for every import recorded in the files.

        Files not read from the database yet answer from its import index, so a
        whole-file check of unchanged files reads nothing else."""
        loc_list = list(loc_list)
        unread = {}
        if self._fUnread:
            unread = {loc.fUrl: self._fStored[loc.fUrl][0] for loc in loc_list
                      if loc not in self._fInfos and getattr(loc, 'fUrl', None) in self._fUnread}
        stored = self._Db().ReadImports(list(unread.values())) if unread else {}
        result = []
        for loc in loc_list:
            fid = unread.get(getattr(loc, 'fUrl', None))
            if fid is not None:
                for scope_name, eq in stored.get(fid, ()):
                    result.append((loc, scope_name, eq.encode('utf-8', 'surrogateescape')))
            else:
                result.extend(self._Imports(loc, self._fInfos.get(loc, {})))
        return result

    @staticmethod
    def _Imports(loc: Any, infos: dict[str, CScopeInfo]) -> list[tuple[Any, str, bytes]]:
        result = []
        prefixes = (symbolinfo.kImportPrefix, symbolinfo.kFromImportPrefix)
        for scope_name, info in infos.items():
            for value in info.type_equivs.values():
                for eq in symbolinfo.NonNestedSplit(value, symbolinfo.kEquivSeparator):
                    if eq.startswith(prefixes):
                        result.append((loc, scope_name, eq))
        return result

    def GetScansDoneForMultipleFiles(self, mtime_dict: dict[Any, float]) -> dict[Any, str]:
        """loc -> space-separated names of the scans done for the file at that time."""
        result = {}
        for loc, mtime in mtime_dict.items():
            done = self._ScansOf(loc)
            result[loc] = ' '.join(name for name, t in done.items() if t == mtime)
        return result

    def _ScansOf(self, loc: Any) -> dict[str, float]:
        done = self._fScansDone.get(loc)
        if done is None:
            stored = self._fStored.get(getattr(loc, 'fUrl', None))
            if stored is None or stored[1] is None:
                return {}
            return stored[1]
        return done

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
        self._ReadIfStored(loc)
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
        self._ReadIfStored(loc)
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
            dependents = [d for d in self.GetDependents(loc) if d != loc]
            triples = [(d, symbolinfo.kWildcardScope, self.fDerivedScanName)
                       for d in sorted(dependents) if self.fLocCache.WantDerivedInfo(d)]
            if triples:
                self.NoteNeedsScan(triples)
        return changed

    def ForgetFile(self, loc: Any) -> None:
        """Drop everything known about ``loc`` (the file is gone)."""
        for table in (self._fInfos, self._fDerived, self._fScansDone, self._fDepsOf):
            table.pop(loc, None)
        self._fUnread.discard(getattr(loc, 'fUrl', None))
        self._fParseTrees.pop(loc, None)
        self._fDirty.add(loc)

    def SetDerivedInfo(self, loc: Any, scope_name: str, derived: dict[str, str],
                       dependencies: Iterable[Any] = ()) -> None:
        self._ReadIfStored(loc)
        self._fDerived.setdefault(loc, {})[scope_name] = dict(derived)
        deps = self._fDepsOf.setdefault(loc, set())
        for dep in dependencies:
            self._fDependents[dep].add(loc)
            deps.add(dep)
        self._fDirty.add(loc)

    def ResetDependencies(self, loc: Any) -> None:
        """The file's derived information is being rebuilt from scratch: forget
        which files the old one used."""
        self._ReadIfStored(loc)
        self._fDepsOf[loc] = set()
        self._fDirty.add(loc)

    def GetDependents(self, loc: Any) -> set[Any]:
        """Files whose derived information used ``loc`` (this session's and the
        database's)."""
        result = set(self._fDependents.get(loc, ()))
        url = getattr(loc, 'fUrl', None)
        if self._fDatabase is not None and url in self._fIds:
            if self._fStoredDependents is None:
                self._fStoredDependents = self._ReadStoredDependents()
            result.update(location.CreateFromName(u)
                          for u in self._fStoredDependents.get(url, ()))
        return result

    def _UrlsById(self) -> dict[int, str]:
        if self._fUrlsById is None:
            self._fUrlsById = {fid: url for url, fid in self._fIds.items()}
        return self._fUrlsById

    def _ReadStoredDependents(self) -> dict[str, set[str]]:
        urls = self._UrlsById()
        reverse: dict[str, set[str]] = collections.defaultdict(set)
        for fid, deps in self._Db().ReadAllDeps():
            url = urls.get(fid)
            if url is None:
                continue
            for dep in deps:
                dep_url = urls.get(dep)
                if dep_url is not None:
                    reverse[dep_url].add(url)
        return reverse

    def RecordScanDone(self, loc: Any, scan_name: str, mtime: float | None) -> None:
        if mtime is not None and mtime > 0:
            self._ReadIfStored(loc)
            self._fScansDone.setdefault(loc, {})[scan_name] = mtime
            self._fDirty.add(loc)

    def GetScanDoneTime(self, loc: Any, scan_name: str) -> float | None:
        return self._ScansOf(loc).get(scan_name)

    def NoteNeedsScan(self, triples: Iterable[tuple[Any, str, str]],
                      priority: int | None = None) -> None:
        """Report scans that other information now needs."""
        triples = list(triples)
        if triples:
            self.emit('needs-scan-added', self, triples, priority)

    def _Store(self, info: CScopeInfo) -> bool:
        loc = info.key.loc
        self._ReadIfStored(loc)
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
        self.fLastFinished = loc
        counts = self.fFinishedScans.get(scan_name)
        if counts is None:
            counts = self.fFinishedScans[scan_name] = [0, 0]
        counts[scope_name != symbolinfo.kWildcardScope] += 1
        if scan_name == self.fDerivedScanName and scope_name == symbolinfo.kWildcardScope:
            self._fParseTrees.pop(loc, None)

    def Trim(self) -> None:
        while len(self._fParseTrees) > kMaxParseTrees:
            self._fParseTrees.popitem(last=False)

    def Clear(self) -> None:
        """Forget everything in memory; what the database holds stays readable."""
        for table in (self._fInfos, self._fDerived, self._fScansDone, self._fDependents,
                      self._fDepsOf, self._fParseTrees):
            table.clear()
        self._fDirty.clear()
        self._fUnread = {url for url, (_id, _s, n) in self._fStored.items()}

    # -- database --------------------------------------------------------------------

    def _Db(self) -> infodb.CInfoDatabase:
        if self._fDatabase is None:
            assert self.fDatabasePath
            db = infodb.CInfoDatabase(self.fDatabasePath)
            db.Open()
            self._fDatabase = db
        return self._fDatabase

    def LoadFromDatabase(self) -> int:
        """Read the database's index of files (which scans are done for which
        modification time); each file's scopes are read when first asked for.
        Returns the number of files with recorded scans.  In-memory information of
        a file wins over the database's.  Raises ``infodb.CDatabaseError`` when the
        database cannot be used."""
        if not self.fDatabasePath or not os.path.exists(self.fDatabasePath):
            return 0
        index = self._Db().LoadIndex()
        self._fStored = index
        self._fIds = {url: entry[0] for url, entry in index.items()}
        in_memory = {loc.fUrl for loc in (*self._fInfos, *self._fScansDone)}
        self._fUnread = {url for url in index if url not in in_memory}
        self._fStoredDependents = None
        self._fUrlsById = None
        return sum(1 for url in self._fUnread if index[url][1])

    def _ReadIfStored(self, loc: Any) -> None:
        if self._fUnread and getattr(loc, 'fUrl', None) in self._fUnread:
            self._Read(loc)

    def _Read(self, loc: Any) -> dict[str, CScopeInfo]:
        """Bring one stored file into memory (its scopes, derived information and
        scans done)."""
        url = loc.fUrl
        self._fUnread.discard(url)
        fid, scans, _n = self._fStored[url]
        data, dep_ids = self._Db().ReadData(fid)
        infos, derived = DecodeFileData(loc, data, self.fPrimaryScanName) if data else ({}, {})
        if dep_ids:
            urls = self._UrlsById()
            self._fDepsOf.setdefault(loc, set()).update(
                location.CreateFromName(urls[i]) for i in dep_ids if i in urls)
        if infos:
            self._fInfos[loc] = infos
        if derived:
            self._fDerived[loc] = derived
        if scans:
            self._fScansDone[loc] = dict(scans)
        return self._fInfos.get(loc, {})

    def WriteToDatabase(self) -> int | None:
        """Write the files changed since the last write, in one transaction; returns
        how many, or None when no database is configured or the write failed.

        A failed write leaves the database as it was and the files still to be
        written; the reason is kept in ``fDatabaseError`` (the caller of this, the
        scan coordinator, does not look at results, so it is not raised)."""
        if not self.fDatabasePath:
            return None
        dirty = list(self._fDirty)
        if not dirty:
            return 0
        try:
            self._WriteFiles(dirty)
        except infodb.CDatabaseError as exc:
            self.fDatabaseError = str(exc)
            return None
        self.fDatabaseError = None
        self._fDirty.difference_update(dirty)
        self.fLastWriteCount = len(dirty)
        return len(dirty)

    def _WriteFiles(self, dirty: list[Any]) -> None:
        db = self._Db()
        rows = []
        deleted = []
        needed: list[str] = []
        for loc in dirty:
            url = loc.fUrl
            infos = self._fInfos.get(loc, {})
            scans = self._fScansDone.get(loc, {})
            derived = self._fDerived.get(loc, {})
            if not infos and not scans and not derived:
                if url in self._fIds:
                    deleted.append(self._fIds[url])
                continue
            needed.append(url)
            deps = self._fDepsOf.get(loc)
            if deps is not None:
                needed.extend(d.fUrl for d in deps)
            rows.append((loc, infos, scans, derived, deps))
        new_urls = list(dict.fromkeys(u for u in needed if u not in self._fIds))
        written: list[tuple[str, dict[str, float], int]] = []

        def encoded():  # one file at a time: the write never holds them all
            for loc, infos, scans, derived, deps in rows:
                imports = [[scope, eq.decode('utf-8', 'surrogateescape')]
                           for _loc, scope, eq in self._Imports(loc, infos)]
                data = EncodeFileData(loc, infos, derived, self.fPrimaryScanName)
                written.append((loc.fUrl, dict(scans), len(infos)))
                yield (loc.fUrl, json.dumps(scans), len(infos), infodb.Pack(imports),
                       infodb.Pack(data), None if deps is None else sorted(d.fUrl for d in deps))
        ids = self._fIds
        db.Write(new_urls, encoded(), deleted, ids)
        if deleted:
            gone = set(deleted)
            for url in [u for u, fid in ids.items() if fid in gone]:
                del ids[url]
                self._fStored.pop(url, None)
        for url, scans, nscopes in written:
            self._fStored[url] = (ids[url], scans, nscopes)
        self._fStoredDependents = None
        self._fUrlsById = None

    def DatabaseWasRebuilt(self) -> bool:
        """Whether the database on disk was of another format and was emptied."""
        return self._fDatabase is not None and self._fDatabase.fRebuilt

    def GetDatabaseStats(self) -> dict[str, int] | None:
        """Files and scopes in the database and its size in bytes (None without one)."""
        if not self.fDatabasePath or not os.path.exists(self.fDatabasePath):
            return None
        return self._Db().Stats()


# -- the stored form of a file's information ---------------------------------------
#
# {'t': the most common file time of the scopes,
#  's': [[scope name, flags, {name: equivalents}, {extras}?], ...],
#  'd': {scope name: {name: derived description}}}
#
# Extras hold only what differs from what can be worked out: 'i' the packed
# definition info when it is not the one the parent scope records for the scope
# (or, for an instance scope, its class's), 't' another file time, 'k' another
# scan name, 'u' and 'n' the definition's location and scope when they are not
# the scope's own.  Equivalents are bytes; they are stored decoded with surrogate
# escapes, which gives them back byte for byte.

_kIncomplete = 1
_kDoesNotExist = 2


def _DefInfoFromParent(infos: dict[str, Any], name: str) -> bytes | None:
    """The packed definition of scope ``name`` as its parent scope records it."""
    if name == symbolinfo.kModuleScope:
        return b''
    if symbolinfo.IsInstanceScope(name):
        cls = infos.get(symbolinfo.GetClassForInstanceName(name))
        return cls.def_info if cls is not None else None
    parent = infos.get(symbolinfo.ParentScopeName(name))
    if parent is None:
        return None
    leaf = symbolinfo.LeafScopeName(name)
    value = parent.type_equivs.get(leaf.partition(symbolinfo.kRedefinitionMark)[0])
    if not value:
        return None
    body = name.encode('utf-8', 'surrogateescape') + b'|'
    for part in value.split(symbolinfo.kEquivSeparator):
        if part[:symbolinfo.kPrefixLen] in symbolinfo.kDefPrefixes and \
                part.startswith(body, symbolinfo.kPrefixLen):
            return part
    return None


def _Order(name: str) -> int:
    """Instance scopes after the others: theirs is worked out from their class."""
    return 1 if symbolinfo.IsInstanceScope(name) else 0


def EncodeFileData(loc: Any, infos: dict[str, CScopeInfo], derived: dict[str, dict[str, str]],
                   primary_scan_name: str) -> dict[str, Any]:
    times = collections.Counter(info.disk_mtime for info in infos.values())
    default_time = times.most_common(1)[0][0] if times else 0.0
    scopes = []
    for name, info in infos.items():
        k = info.key
        flags = (_kIncomplete if info.incomplete else 0) | \
            (_kDoesNotExist if info.does_not_exist else 0)
        equivs = {n: v.decode('utf-8', 'surrogateescape') for n, v in info.type_equivs.items()}
        extras: dict[str, Any] = {}
        if _DefInfoFromParent(infos, name) != info.def_info:
            extras['i'] = info.def_info.decode('utf-8', 'surrogateescape')
        if info.disk_mtime != default_time:
            extras['t'] = info.disk_mtime
        if k.scan_name != primary_scan_name:
            extras['k'] = k.scan_name
        if k.def_loc != loc:
            extras['u'] = k.def_loc.fUrl
        if k.def_scope_name != name:
            extras['n'] = k.def_scope_name
        if k.scope_name != name or k.loc != loc:
            raise ValueError(f'scope information of {k.loc!r} {k.scope_name!r} stored '
                             f'as {loc!r} {name!r}')
        scopes.append([name, flags, equivs, extras] if extras else [name, flags, equivs])
    result: dict[str, Any] = {'t': default_time, 's': scopes}
    if derived:
        result['d'] = derived
    return result


def DecodeFileData(loc: Any, data: dict[str, Any], primary_scan_name: str
                   ) -> tuple[dict[str, CScopeInfo], dict[str, dict[str, str]]]:
    default_time = data['t']
    infos: dict[str, CScopeInfo] = {}
    unresolved = []
    for rec in data['s']:
        name, flags, equivs = rec[0], rec[1], rec[2]
        extras = rec[3] if len(rec) > 3 else {}
        def_loc = location.CreateFromName(extras['u']) if 'u' in extras else loc
        key = CScopeInfoKey(loc, name, extras.get('k', primary_scan_name), def_loc,
                            extras.get('n', name))
        info = CScopeInfo.__new__(CScopeInfo)
        info.key = key
        info.disk_mtime = extras.get('t', default_time)
        info.incomplete = bool(flags & _kIncomplete)
        info.does_not_exist = bool(flags & _kDoesNotExist)
        info.type_equivs = {n: v.encode('utf-8', 'surrogateescape') for n, v in equivs.items()}
        if 'i' in extras:
            info.def_info = extras['i'].encode('utf-8', 'surrogateescape')
        else:
            info.def_info = b''
            unresolved.append(name)
        infos[name] = info
    for name in sorted(unresolved, key=_Order):
        found = _DefInfoFromParent(infos, name)
        if found is None:
            raise ValueError(f'stored definition of {name!r} in {loc!r} cannot be found')
        infos[name].def_info = found
    return infos, data.get('d', {})
