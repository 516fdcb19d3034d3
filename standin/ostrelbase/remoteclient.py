"""Remote agents: servers that hold files of another machine.

The stand-in agent serves a local directory tree under a host name.  Requests
for file status and for file contents complete asynchronously, from the main
loop, after the agent's latency; reading a file is also possible synchronously
once its location has been inspected.  The agent honours the permission bits of
the files it serves: a file without read permission cannot be inspected (its
status request answers ``kInspectFailed``), even when this process runs as root.
Stopping an agent aborts its requests in flight and emits "server-stopped", also
as a class-wide signal that any listener can follow with
``CRemoteServerManager.class_connect_while_alive``.
"""
from __future__ import annotations

import os
import posixpath
import stat
from collections.abc import Callable
from typing import Any

from guiutils import ostrelgtk

from ostrelbase import destroyable
from ostrelbase.location import CStatInfo, ForgetInspections, kInspectFailed

StatCallback = Callable[[dict[str, CStatInfo | None], bool], Any]


class CAgentServerBase(destroyable.CDestroyable):
    """An agent serving ``root_dir`` under ``host``; replies after ``latency_ms``."""

    kSignals = ('server-started', 'server-stopped')

    def __init__(self, host: str, root_dir: str, latency_ms: float = 0) -> None:
        super().__init__(self.kSignals)
        self.fHost = host
        self.fRootDir = os.path.abspath(root_dir)
        self.fLatencyMs = latency_ms
        self.fRunning = False
        self._fRequests: dict[int, tuple[list[str], Callable[[dict, bool], Any]]] = {}

    def Start(self) -> None:
        if not self.fRunning:
            self.fRunning = True
            self.emit('server-started', self)

    def Stop(self) -> None:
        """Stop serving: abort requests in flight and forget what was inspected."""
        if self._StopSilently():
            self.emit('server-stopped', self)

    def _StopSilently(self) -> bool:
        if not self.fRunning:
            return False
        self.fRunning = False
        requests = list(self._fRequests.items())
        self._fRequests.clear()
        for sid, (_paths, callback) in requests:
            ostrelgtk.timeout_remove(sid)
            callback({}, True)
        ForgetInspections(self.fHost)
        return True

    def _destroy_impl(self) -> None:
        # No emission from an object being destroyed; UnregisterAll stops first.
        self._StopSilently()

    def MapPath(self, path: str) -> str:
        """The local file behind a remote path (never outside the served tree)."""
        rel = posixpath.normpath('/' + path).lstrip('/')
        return os.path.join(self.fRootDir, *[p for p in rel.split('/') if p])

    def StatNow(self, path: str) -> CStatInfo | None:
        """The status of ``path``: None when it does not exist, ``kInspectFailed``
        when it exists but cannot be read."""
        local = self.MapPath(path)
        try:
            st = os.stat(local)
        except (FileNotFoundError, NotADirectoryError):
            return None
        except OSError:
            return kInspectFailed
        is_dir = stat.S_ISDIR(st.st_mode)
        if not is_dir and not st.st_mode & 0o444:
            return kInspectFailed
        return CStatInfo(True, is_dir, st.st_mtime, st.st_size, stat.S_ISREG(st.st_mode))

    def ReadNow(self, path: str) -> bytes | None:
        """The contents of ``path``, None when it cannot be read."""
        if self.StatNow(path) in (None, kInspectFailed):
            return None
        try:
            return self.ReadFile(path)
        except OSError:
            return None

    def RequestStat(self, paths: list[str], callback: StatCallback) -> None:
        """Ask for the status of ``paths``; ``callback(results, abort)`` runs later."""
        self._Request(paths, callback, self.StatNow)

    def RequestRead(self, paths: list[str],
                    callback: Callable[[dict[str, bytes | None], bool], Any]) -> None:
        """Ask for the contents of ``paths``; ``callback(results, abort)`` runs later
        (None for a file that could not be read)."""
        self._Request(paths, callback, self.ReadNow)

    def _Request(self, paths: list[str], callback: Callable[[dict, bool], Any],
                 answer: Callable[[str], Any]) -> None:
        if not self.fRunning:
            ostrelgtk.idle_add(lambda: callback({}, True))
            return
        paths = list(paths)
        sid_holder: list[int] = []

        def reply() -> bool:
            self._fRequests.pop(sid_holder[0], None)
            callback({p: answer(p) for p in paths}, False)
            return False

        if self.fLatencyMs > 0:
            sid = ostrelgtk.timeout_add_while_alive(self.fLatencyMs, reply, self)
        else:
            sid = ostrelgtk.idle_add_while_alive(reply, self)
        sid_holder.append(sid)
        self._fRequests[sid] = (paths, callback)

    def ReadFile(self, path: str) -> bytes:
        if not self.fRunning:
            raise OSError(f'remote agent {self.fHost!r} is not running')
        with open(self.MapPath(path), 'rb') as f:
            return f.read()

    def ListDir(self, path: str) -> list[str]:
        try:
            return sorted(os.listdir(self.MapPath(path)))
        except OSError:
            return []


class CRemoteServerManager(CAgentServerBase):
    """A remote host's agent."""


_gServers: dict[str, CAgentServerBase] = {}


def RegisterServer(host: str, root_dir: str, latency_ms: float = 0,
                   kind: type[CAgentServerBase] = CRemoteServerManager) -> CAgentServerBase:
    """Create and start an agent serving ``root_dir`` as ``remote://host/``."""
    old = _gServers.get(host)
    if old is not None:
        old.Stop()
        old.destroy()
    server = kind(host, root_dir, latency_ms)
    _gServers[host] = server
    server.Start()
    return server


def GetServer(host: str) -> CAgentServerBase | None:
    server = _gServers.get(host)
    return server if server is not None and server.fRunning else None


def UnregisterAll() -> None:
    """Stop and drop every agent (tests, application exit)."""
    servers = list(_gServers.values())
    _gServers.clear()
    for server in servers:
        server.Stop()
        server.destroy()
