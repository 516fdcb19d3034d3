"""A project whose files are reached through a remote agent.

``CRemoteProject(root, latency_s)`` registers an agent that serves the whole
file system under the host name ``kHost`` with the given latency, so that a
project file ``/p/x.py`` is the remote location ``remote://<kHost>/p/x.py``: the
same path, its data arriving asynchronously (inspection, then contents).  The
analysis engine then parks the work of files that are not inspected yet, and
scanners wait for the contents.

The project keeps the outcome of inspections: ``fInspectFailed`` holds the
locations whose inspection the location data cache reported failed (their
work stays parked in the scan queue).
"""
from __future__ import annotations

from collections.abc import Iterable
from typing import Any

from ostrelbase import location, remoteclient

kHost = 'project-agent'


class CRemoteProject:
    def __init__(self, root: str, latency_s: float) -> None:
        if latency_s < 0:
            raise ValueError('the latency must not be negative')
        self.fRoot = root
        self.fLatency = latency_s
        self.fServer = remoteclient.RegisterServer(kHost, '/', latency_s * 1000.0)
        self.fInspectFailed: set[Any] = set()
        self._fConnected: Any = None

    def Location(self, path: str) -> location.CRemoteFileLocation:
        return location.CRemoteFileLocation(kHost, path)

    def Locations(self, local_locs: Iterable[Any]) -> list[location.CRemoteFileLocation]:
        return [self.Location(loc.fPath) for loc in local_locs]

    def PythonPath(self, follow_stdlib: bool) -> list[Any]:
        """The project directory (remote), then the local standard library."""
        from pysource import analysismgr
        path: list[Any] = [self.Location(self.fRoot)]
        if follow_stdlib:
            path.append(location.CLocalFileLocation(analysismgr.StdlibDir()))
        return path

    def Adopt(self, ana_mgr: Any) -> None:
        """Make the remote directory the project's (derived information is built
        for its files) and follow the location data cache's reports of failed
        inspections."""
        ana_mgr.fLocCache.fProjectDirs = [self.Location(self.fRoot)]
        def on_failed(_cache: Any, loc_set: Iterable[Any]) -> None:
            self.fInspectFailed.update(loc_set)

        def on_ready(_cache: Any, ready_set: Iterable[Any]) -> None:
            self.fInspectFailed.difference_update(ready_set)

        cache = ana_mgr.fLocationDataCache
        cache.connect('inspect-failed', on_failed)
        cache.connect('now-tree-branch-ready', on_ready)

    def Busy(self) -> bool:
        """Whether the agent has requests in flight."""
        return bool(self.fServer._fRequests)

    def Close(self) -> None:
        remoteclient.UnregisterAll()
        location.ForgetInspections(kHost)


def DatabaseContents(db_path: str) -> dict[str, tuple]:
    """Everything a project database holds, per file, with this module's remote
    URLs written as the local ones they stand for (to compare a remote run with a
    local one): url -> (scans, scope count, imports, data, URLs of dependencies)."""
    import json

    from pysource import infodb

    def local(text: str) -> str:
        return text.replace(location.kRemoteScheme + kHost, location.kLocalScheme)

    db = infodb.CInfoDatabase(db_path)
    db.Open()
    try:
        index = db.LoadIndex()
        urls = {fid: url for url, (fid, _scans, _n) in index.items()}
        result = {}
        for url, (fid, scans, nscopes) in index.items():
            data, deps = db.ReadData(fid)
            imports = db.ReadImports([fid]).get(fid)
            body = local(json.dumps([imports, data], sort_keys=True))
            result[local(url)] = (json.dumps(scans, sort_keys=True), nscopes, body,
                                  sorted(local(urls.get(d, '?')) for d in deps))
        return result
    finally:
        db.Close()
