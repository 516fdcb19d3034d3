"""Locations: the names of files and directories, local or on a remote agent.

Design note
-----------
A location is an immutable value object identified by its URL (``fUrl``); it
hashes and compares by URL, so two objects naming the same file are
interchangeable as dictionary keys.

- ``CLocalFileLocation``: a path on this machine (``file://`` URL).  Its data is
  always available: ``IsReady()`` is True and it is never "async-inspect".
- ``CRemoteFileLocation``: a path on a remote agent (``remote://host/path``).  Its
  data arrives asynchronously: before use it must be inspected, which asks the
  agent (``remoteclient``) for its status and completes later, from the main loop.
  ``IsReady()`` is True once an inspection succeeded.

The inspection state of remote locations lives in this module (``_gInspections``)
so that ``IsReady()`` needs no other object.  ``_WaitForInspectMultiple`` starts
inspections and calls back once every location of a request is inspected.  An
inspection that the agent cannot complete for one file (it cannot read it) leaves
that file uninspected and ends its waits with ``abort``.

A remote file's contents are a second round trip: ``_WaitForData`` inspects the
file if needed, then fetches its contents, which ``ReadBytes`` hands out once
(later reads go to the agent directly).  Scanners wait for the data this way.
"""
from __future__ import annotations

import os
import posixpath
import stat
from collections.abc import Callable, Iterable
from typing import Any, NamedTuple

kLocalScheme = 'file://'
kRemoteScheme = 'remote://'


class CNotReadyError(RuntimeError):
    """Raised when the data of an uninspected remote location is read."""


class CStatInfo(NamedTuple):
    """What an inspection learns about a location."""

    exists: bool
    is_dir: bool
    mtime: float
    size: int
    is_file: bool = True  # a regular file (not a directory, pipe, socket or device)


kMissingStat = CStatInfo(False, False, 0.0, 0, False)
# What an agent answers for a file it cannot inspect (it exists but cannot be read).
kInspectFailed = CStatInfo(False, False, -1.0, -1, False)


class CLocation:
    """Base class of locations: hashable, compared by URL."""

    __slots__ = ('fUrl',)

    fUrl: str

    def __hash__(self) -> int:
        return hash(self.fUrl)

    def __eq__(self, other: object) -> bool:
        if self is other:
            return True
        if not isinstance(other, CLocation):
            return NotImplemented
        return self.fUrl == other.fUrl

    def __ne__(self, other: object) -> bool:
        result = self.__eq__(other)
        return result if result is NotImplemented else not result

    def __lt__(self, other: CLocation) -> bool:
        return self.fUrl < other.fUrl

    def __repr__(self) -> str:
        return f'{type(self).__name__}({self.fUrl!r})'

    def __reduce__(self) -> tuple:
        return (CreateFromName, (self.fUrl,))

    # Overridden by subclasses
    def GetParentDir(self) -> CLocation:
        raise NotImplementedError

    def IsReady(self) -> bool:
        raise NotImplementedError

    def GetStat(self) -> CStatInfo:
        raise NotImplementedError

    def ReadBytes(self) -> bytes:
        raise NotImplementedError

    def ListDir(self) -> list[str]:
        raise NotImplementedError

    def Join(self, *names: str) -> CLocation:
        raise NotImplementedError

    # Shared
    def GetBaseName(self) -> str:
        return posixpath.basename(self.fUrl.rstrip('/'))

    def Exists(self) -> bool:
        return self.GetStat().exists

    def IsDir(self) -> bool:
        return self.GetStat().is_dir

    def GetMTime(self) -> float:
        """Modification time, 0.0 for a missing (or not yet inspected) file."""
        st = self.GetStat()
        return st.mtime if st.exists else 0.0


class CLocalFileLocation(CLocation):
    """A file or directory on the local disk."""

    __slots__ = ('fPath',)

    def __init__(self, path: str) -> None:
        self.fPath = os.path.abspath(os.fspath(path))  # normalised too
        self.fUrl = kLocalScheme + self.fPath

    @classmethod
    def _FromNormalPath(cls, path: str) -> CLocalFileLocation:
        """A location for an absolute path that is already normalised."""
        loc = cls.__new__(cls)
        loc.fPath = path
        loc.fUrl = kLocalScheme + path
        return loc

    def GetParentDir(self) -> CLocalFileLocation:
        return self._FromNormalPath(os.path.dirname(self.fPath))

    def IsReady(self) -> bool:
        return True

    def GetStat(self) -> CStatInfo:
        try:
            st = os.stat(self.fPath)
        except OSError:
            return kMissingStat
        return CStatInfo(True, stat.S_ISDIR(st.st_mode), st.st_mtime, st.st_size,
                         stat.S_ISREG(st.st_mode))

    def ReadBytes(self) -> bytes:
        with open(self.fPath, 'rb') as f:
            return f.read()

    def ListDir(self) -> list[str]:
        try:
            return sorted(os.listdir(self.fPath))
        except OSError:
            return []

    def Join(self, *names: str) -> CLocalFileLocation:
        return self._FromNormalPath(os.path.normpath(os.path.join(self.fPath, *names)))


class CRemoteFileLocation(CLocation):
    """A file or directory served by a remote agent; data arrives asynchronously."""

    __slots__ = ('fHost', 'fPath')

    def __init__(self, host: str, path: str) -> None:
        if not host or '/' in host:
            raise ValueError(f'bad remote host name {host!r}')
        self.fHost = host
        self.fPath = posixpath.normpath('/' + path.lstrip('/'))
        self.fUrl = f'{kRemoteScheme}{host}{self.fPath}'

    def GetParentDir(self) -> CRemoteFileLocation:
        return CRemoteFileLocation(self.fHost, posixpath.dirname(self.fPath))

    def IsReady(self) -> bool:
        return _gInspections.GetStat(self) is not None

    def GetStat(self) -> CStatInfo:
        return _gInspections.GetStat(self) or kMissingStat

    def ReadBytes(self) -> bytes:
        if not self.IsReady():
            raise CNotReadyError(f'{self.fUrl} has not been inspected')
        data = _gInspections.TakeData(self)
        if data is not None:
            return data
        server = _GetServer(self.fHost)
        if server is None:
            raise CNotReadyError(f'no remote agent for {self.fHost!r}')
        return server.ReadFile(self.fPath)

    def ListDir(self) -> list[str]:
        server = _GetServer(self.fHost)
        if server is None or not self.IsReady():
            return []
        return server.ListDir(self.fPath)

    def Join(self, *names: str) -> CRemoteFileLocation:
        return CRemoteFileLocation(self.fHost, posixpath.join(self.fPath, *names))


def CreateFromName(name: str | os.PathLike) -> CLocation:
    """A location from a local path, a ``file://`` URL or a ``remote://host/path`` URL."""
    name = os.fspath(name)
    if name.startswith(kRemoteScheme):
        host, _sep, path = name[len(kRemoteScheme):].partition('/')
        return CRemoteFileLocation(host, '/' + path)
    name = name.removeprefix(kLocalScheme)
    return CLocalFileLocation(name)


def IsAsyncInspectLocation(loc: Any) -> bool:
    """True when the location's data arrives asynchronously (remote files)."""
    return isinstance(loc, CRemoteFileLocation)


def _GetServer(host: str) -> Any:
    from ostrelbase import remoteclient  # imported on use: remote support is optional
    return remoteclient.GetServer(host)


class _CWaiter:
    __slots__ = ('fAbort', 'fCallback', 'fRemaining')

    def __init__(self, remaining: set[CRemoteFileLocation],
                 callback: Callable[[bool], Any]) -> None:
        self.fRemaining = remaining
        self.fCallback = callback
        self.fAbort = False


class _CInspections:
    """Inspection results of remote locations and the requests in flight."""

    def __init__(self) -> None:
        self._fStats: dict[CRemoteFileLocation, CStatInfo] = {}
        self._fInFlight: set[CRemoteFileLocation] = set()
        self._fWaiters: list[_CWaiter] = []
        self._fData: dict[CRemoteFileLocation, bytes] = {}
        self._fDataWaiters: dict[CRemoteFileLocation, list[Callable[[bool], Any]]] = {}

    def GetStat(self, loc: CRemoteFileLocation) -> CStatInfo | None:
        return self._fStats.get(loc)

    def Forget(self, host: str | None = None) -> None:
        """Drop inspection results (of one host, or all)."""
        if host is None:
            self._fStats.clear()
            self._fData.clear()
        else:
            for table in (self._fStats, self._fData):
                for loc in [loc for loc in table if loc.fHost == host]:
                    del table[loc]

    def HasData(self, loc: CRemoteFileLocation) -> bool:
        return loc in self._fData

    def TakeData(self, loc: CRemoteFileLocation) -> bytes | None:
        return self._fData.pop(loc, None)

    def WaitForData(self, loc: CRemoteFileLocation, callback: Callable[[bool], Any]) -> None:
        """``callback(abort)`` once the contents of ``loc`` have arrived."""
        if loc in self._fData:
            callback(False)
            return
        waiters = self._fDataWaiters.setdefault(loc, [])
        waiters.append(callback)
        if len(waiters) > 1:
            return  # a fetch is in flight

        def done(results: dict[str, bytes | None], abort: bool) -> None:
            data = None if abort else results.get(loc.fPath)
            if data is not None:
                self._fData[loc] = data
            for waiter in self._fDataWaiters.pop(loc, []):
                waiter(data is None)

        server = _GetServer(loc.fHost)
        if server is None:
            from guiutils import ostrelgtk
            ostrelgtk.idle_add(lambda: done({}, True))
            return
        server.RequestRead([loc.fPath], done)

    def Wait(self, locs: list[CRemoteFileLocation], callback: Callable[[bool], Any],
             force: bool) -> None:
        waiter = _CWaiter(set(locs), callback)
        self._fWaiters.append(waiter)
        by_host: dict[str, list[CRemoteFileLocation]] = {}
        for loc in locs:
            if loc in self._fInFlight and not force:
                continue
            self._fInFlight.add(loc)
            by_host.setdefault(loc.fHost, []).append(loc)
        for host, host_locs in by_host.items():
            self._Request(host, host_locs)

    def _Request(self, host: str, locs: list[CRemoteFileLocation]) -> None:
        server = _GetServer(host)

        def done(results: dict[str, CStatInfo | None], abort: bool) -> None:
            self._Completed(locs, results, abort)

        if server is None:
            # No agent for the host: fail, but from the main loop like a real reply.
            from guiutils import ostrelgtk

            def fail() -> None:
                done({}, True)
            ostrelgtk.idle_add(fail)
            return
        server.RequestStat([loc.fPath for loc in locs], done)

    def _Completed(self, locs: list[CRemoteFileLocation],
                   results: dict[str, CStatInfo | None], abort: bool) -> None:
        failed = set()
        for loc in locs:
            self._fInFlight.discard(loc)
            if abort:
                continue
            st = results.get(loc.fPath) or kMissingStat
            if st == kInspectFailed:
                failed.add(loc)  # stays uninspected
            else:
                self._fStats[loc] = st
        finished = []
        for waiter in self._fWaiters:
            hit = waiter.fRemaining.intersection(locs)
            if hit:
                waiter.fRemaining.difference_update(hit)
                waiter.fAbort = waiter.fAbort or abort or not failed.isdisjoint(hit)
                if not waiter.fRemaining:
                    finished.append(waiter)
        # Bookkeeping is complete before any callback runs: a callback may start
        # new waits.
        for waiter in finished:
            self._fWaiters.remove(waiter)
        for waiter in finished:
            waiter.fCallback(waiter.fAbort)


_gInspections = _CInspections()


def _WaitForInspectMultiple(loc_seq: Iterable[Any], callback: Callable[[bool], Any],
                            force: bool = False) -> None:
    """Call ``callback(abort)`` once every location of ``loc_seq`` is inspected.

    Local locations need no inspection; if nothing needs inspecting the callback
    runs before this returns.  Otherwise it runs later from the main loop, with
    ``abort`` true when the remote agent gave up (stopped or unknown).  ``force``
    inspects remote locations again even when they were inspected before.
    """
    need = [loc for loc in loc_seq
            if IsAsyncInspectLocation(loc) and (force or not loc.IsReady())]
    if not need:
        callback(False)
        return
    _gInspections.Wait(need, callback, force)


def HasData(loc: Any) -> bool:
    """Whether the contents of ``loc`` are at hand (always, for a local file)."""
    return not IsAsyncInspectLocation(loc) or _gInspections.HasData(loc)


def _WaitForData(loc: Any, callback: Callable[[bool], Any]) -> None:
    """Call ``callback(abort)`` once ``loc`` is inspected and its contents arrived;
    at once when they are at hand."""
    if HasData(loc):
        callback(False)
        return

    def inspected(abort: bool) -> None:
        if abort:
            callback(True)
        else:
            _gInspections.WaitForData(loc, callback)
    _WaitForInspectMultiple([loc], inspected, False)


def ForgetInspections(host: str | None = None) -> None:
    """Forget what is known about remote locations (of one host, or all)."""
    _gInspections.Forget(host)


def ResetForTests() -> None:
    """Drop all inspection state, including requests in flight."""
    global _gInspections
    _gInspections = _CInspections()
