"""The helper process: a second process that scans whole local files.

Design note
-----------
``CHelperProcessSupport`` is the analysis manager's ``_fHelperProcessSupport``.
``Start()`` launches the worker (``multiprocessing``, spawn context: a fresh
interpreter that builds its own host for the project) and publishes the proxy
as ``fHelperProcessProxy``; ``fHelperCallbackObj`` emits
"scan-queue-locs-added" and "scan-queue-locs-removed" with the locations the
worker gained and finished.  Everything here runs on the main thread; the
worker is reached through one pipe.

- Sending: the proxy's ``AddPairsToPrimaryQueue`` sends the files to the worker,
  at most ``max_backlog`` at a time; the "scan-queue-locs-added" emission follows
  from an idle callback.  Files beyond that go back to the local queue (with
  "scan-queue-locs-removed"), so that both processes scan; so do files whose
  primary scan is recorded for their current modification time, which the
  local whole-file check then drops.
- Taking over: while the worker has fewer than ``max_backlog`` files, the poll
  moves queued whole-file primary scans from the end of the local queue over to
  it, as the coordinator's hand-over does when a helper process starts.
- Receiving: a timeout of ``kPollMs`` reads what the worker sent, without
  blocking.  A result is stored in the main process's information cache, the
  follow-up work is queued as after a local scan (imported modules, secondary
  locations, the derived scan) and "scan-queue-locs-removed" is emitted.
- Gone: a worker that exits, is killed, sends something that is not a result,
  or holds a file longer than ``deadline`` seconds is stopped for good; the
  proxy is withdrawn (``fHelperProcessProxy = None``) and the coordinator's
  ``_UpdateForHelperProcess`` takes the unfinished files back into the local
  queue.  ``fGoneReason`` says why.

The worker scans with the same scanner class as the main process
(``scopescanner.CWholeFilePrimaryScanner``) and returns the scopes' information
objects, the modification time they were built from and the incomplete scopes.
A reader thread in the worker drains the pipe, so the main process's sends never
wait for a scan to end.
"""
from __future__ import annotations

import heapq
import multiprocessing
import queue
import signal
import threading
import time
from typing import Any

import singleton
from guiutils import ostrelgtk
from ostrelbase import destroyable, location

from pysource import scopeinfo

kPollMs = 5
kDefaultDeadline = 30.0  # seconds a file may take
kStartupDeadline = 60.0  # seconds the worker may take to get ready
kPollBudget = 0.02  # seconds of result handling per poll
kBackgroundPriority = 2
kInteractivePriority = 1


class CHelperCallbackObj(destroyable.CDestroyable):
    """Reports the locations the helper process gained or finished."""

    def __init__(self) -> None:
        super().__init__(('scan-queue-locs-added', 'scan-queue-locs-removed'))


class CHelperProcessProxy:
    """What the coordinator calls: fire and forget."""

    def __init__(self, support: CHelperProcessSupport) -> None:
        self._fSupport = support

    def AddPairsToPrimaryQueue(self, pairs: Any, first: bool = False, callback: Any = None,
                               priority: int | None = None) -> None:
        if priority is None:
            priority = kInteractivePriority if first else kBackgroundPriority
        self._fSupport._Send([loc for loc, _scope in pairs], priority, bool(first))

    def FlushQueue(self, callback: Any = None) -> None:
        self._fSupport._Flush()


class CHelperProcessSupport(destroyable.CDestroyable):
    """The worker process and its bookkeeping (see the module note)."""

    def __init__(self, ana_mgr: Any, project_dir: str, deadline: float = kDefaultDeadline,
                 max_backlog: int = 8, worker: Any = None, worker_args: tuple = ()) -> None:
        super().__init__(())
        self.fAnaMgr = ana_mgr
        self.fProjectDir = project_dir
        self.fDeadline = deadline
        self.fHelperCallbackObj: CHelperCallbackObj | None = CHelperCallbackObj()
        self.fProxy = CHelperProcessProxy(self)
        self.fProcess: Any = None
        self.fGoneReason: str | None = None
        self.fScanned: dict[Any, int] = {}  # location -> scopes, of the files it scanned
        self.fHandedBack = 0  # unfinished files taken back into the local queue
        self.fSentBackUpToDate = 0  # files it was sent that were up to date
        self.fSentBackBusy = 0  # files it was sent while its queue was full
        self.fMaxBacklog = max_backlog
        self.fTakenFromLocal = 0  # files moved from the local queue to it
        self._fWorker = worker if worker is not None else _WorkerMain
        self._fWorkerArgs = worker_args
        self._fConn: Any = None
        self._fPending: dict[Any, int] = {}  # location -> priority, sent and not answered
        self._fToAnnounce: list[Any] = []
        self._fAnnounceIdle: Any = None
        self._fPollId: Any = None
        self._fLastProgress = 0.0
        self._fReady = False  # the worker has built its host

    # -- life ------------------------------------------------------------------------

    def Start(self) -> None:
        ana_mgr = self.fAnaMgr
        ctx = multiprocessing.get_context('spawn')
        parent, child = ctx.Pipe()
        config = {'project_dir': self.fProjectDir,
                  'python_path': [loc.fUrl for loc in ana_mgr.fPyConfig.python_path_locs],
                  'scan_name': ana_mgr.fPrimaryScanName}
        self.fProcess = ctx.Process(target=self._fWorker, args=(child, config,
                                                                *self._fWorkerArgs),
                                    name='scan-helper', daemon=True)
        self.fProcess.start()
        child.close()
        self._fConn = parent
        self._fLastProgress = time.monotonic()
        self._fPollId = ostrelgtk.timeout_add_while_alive(kPollMs, self._CB_Poll, self)
        ana_mgr._fHelperProcessSupport = self
        ana_mgr.fHelperProcessProxy = self.fProxy

    def Busy(self) -> bool:
        """Whether the worker still has files to return."""
        return self.fGoneReason is None and bool(self._fPending)

    def Stop(self) -> None:
        """End the worker (its unfinished files are not taken back)."""
        if self._fConn is not None:
            try:
                self._fConn.send(('quit',))
            except (OSError, ValueError):
                pass
        self._EndProcess()
        if self.fAnaMgr.fHelperProcessProxy is self.fProxy:
            self.fAnaMgr.fHelperProcessProxy = None

    def _destroy_impl(self) -> None:
        self.Stop()
        if self.fHelperCallbackObj is not None:
            self.fHelperCallbackObj.destroy()
        if self.fAnaMgr._fHelperProcessSupport is self:
            self.fAnaMgr._fHelperProcessSupport = None

    def _EndProcess(self) -> None:
        if self._fPollId is not None:
            ostrelgtk.timeout_remove(self._fPollId)
            self._fPollId = None
        if self._fAnnounceIdle is not None:
            ostrelgtk.idle_remove(self._fAnnounceIdle)
            self._fAnnounceIdle = None
        proc, self.fProcess = self.fProcess, None
        if proc is not None:
            proc.join(1.0)
            if proc.is_alive():
                proc.kill()
                proc.join(5.0)
        if self._fConn is not None:
            self._fConn.close()
            self._fConn = None

    # -- sending ---------------------------------------------------------------------

    def _Send(self, locs: list[Any], priority: int, first: bool) -> None:
        if self.fGoneReason is not None:
            raise RuntimeError('the helper process is gone')
        cache = self.fAnaMgr.fInfoCache
        primary = self.fAnaMgr.fPrimaryScanName
        up_to_date, sent, busy = [], [], []
        for loc in locs:
            if loc in self._fPending:
                continue  # in the worker's queue already
            done = cache.GetScanDoneTime(loc, primary)
            if done is not None and done == loc.GetMTime():
                up_to_date.append(loc)
            elif len(self._fPending) + len(sent) < self.fMaxBacklog:
                sent.append(loc)
            else:
                busy.append(loc)
        if sent:
            if not self._fPending:
                self._fLastProgress = time.monotonic()
            for loc in sent:
                self._fPending[loc] = priority
            try:
                self._fConn.send(('add', [loc.fUrl for loc in sent], priority, first))
            except (OSError, ValueError) as exc:
                self._fToAnnounce.extend(sent)
                self._Gone(f'cannot send to it: {exc}')
                return
            self._fToAnnounce.extend(sent)
            if self._fAnnounceIdle is None:
                self._fAnnounceIdle = ostrelgtk.idle_add(self._CB_Announce)
        self.fSentBackUpToDate += len(up_to_date)
        self.fSentBackBusy += len(busy)
        local = up_to_date + busy
        if local:
            # Back to the local queue: up-to-date files are dropped by its whole-file
            # check (which queues their follow-up work), the others are scanned
            # there while the worker is busy.
            coord = self.fAnaMgr.fScanCoordinator
            self._Emit('scan-queue-locs-removed', local)
            coord._fScanQueue.AddScanPairs([(loc, '*') for loc in local], primary,
                                           priority, True)
            coord._ScheduleIdle()

    def _Flush(self) -> None:
        self._fPending.clear()
        self._fToAnnounce.clear()
        if self._fConn is not None and self.fGoneReason is None:
            try:
                self._fConn.send(('flush',))
            except (OSError, ValueError) as exc:
                self._Gone(f'cannot send to it: {exc}')

    def _CB_Announce(self) -> bool:
        self._fAnnounceIdle = None
        self._AnnounceNow()
        return False

    def _AnnounceNow(self) -> None:
        locs, self._fToAnnounce = self._fToAnnounce, []
        if locs:
            self._Emit('scan-queue-locs-added', locs)

    def _Emit(self, signal_name: str, locs: list[Any]) -> None:
        if signal_name == 'scan-queue-locs-removed':
            self._AnnounceNow()  # a listener sees a location added before it is removed
        if self.fHelperCallbackObj is not None:
            self.fHelperCallbackObj.emit(signal_name, self.fHelperCallbackObj, locs)

    # -- receiving -------------------------------------------------------------------

    def _CB_Poll(self) -> bool:
        started = time.monotonic()
        try:
            while self._fConn is not None and self._fConn.poll(0):
                message = self._fConn.recv()
                self._fLastProgress = time.monotonic()
                if not self._Handle(message):
                    self._Gone('it sent something that is not a result')
                    return False
                if time.monotonic() - started > kPollBudget:
                    return True
        except (EOFError, OSError) as exc:
            proc = self.fProcess
            if proc is not None:
                proc.join(1.0)
            if proc is not None and proc.exitcode is not None:
                self._Gone(f'it exited (status {proc.exitcode})')
            else:
                self._Gone(f'its pipe closed ({type(exc).__name__})')
            return False
        except Exception as exc:  # noqa: BLE001 - an unreadable message: the worker is broken
            self._Gone(f'it sent an unreadable message ({type(exc).__name__})')
            return False
        if self.fProcess is not None and not self.fProcess.is_alive():
            self._Gone(f'it exited (status {self.fProcess.exitcode})')
            return False
        deadline = self.fDeadline if self._fReady else max(self.fDeadline, kStartupDeadline)
        if self._fPending and time.monotonic() - self._fLastProgress > deadline:
            self._Gone(f'no answer for {deadline:g} s')
            return False
        if len(self._fPending) < self.fMaxBacklog:
            self._TakeFromLocalQueue(self.fMaxBacklog - len(self._fPending))
        return True

    def _TakeFromLocalQueue(self, count: int) -> None:
        """Move up to ``count`` queued whole-file primary scans of the local queue
        (from its end, so not what it is about to scan) over to the worker, as the
        coordinator does when a helper process starts."""
        coord = self.fAnaMgr.fScanCoordinator
        if coord is None:
            return
        sq = coord._fScanQueue
        primary = self.fAnaMgr.fPrimaryScanName
        cache = self.fAnaMgr.fInfoCache
        active = coord._CScanCoordinator__fActivePrimaryWholeFileScanners
        for single in reversed(list(sq._fOrderedQueues)):
            if count <= 0 or single.fScanName != primary or not len(single.fOrderedDict):
                continue
            taken = []
            for loc, names in reversed(list(single.fOrderedDict.items())):
                if len(taken) >= count:
                    break
                if (names == ['*'] and loc not in active and loc not in self._fPending
                        and coord._CanSendToHelperProcess(loc, '*')
                        and cache.GetScanDoneTime(loc, primary) != loc.GetMTime()):
                    taken.append(loc)
            for loc in taken:
                sq.RemoveScanTriple((loc, '*', primary), single.fPriority)
                sq._fWholeFilesToCheck.pop(loc, None)
            if taken:
                self.fTakenFromLocal += len(taken)
                self._Send(taken, single.fPriority, False)
                count -= len(taken)

    def _Handle(self, message: Any) -> bool:
        """Take in one message; False when it is not a well-formed result."""
        if not isinstance(message, tuple) or not message:
            return False
        if message == ('ready',):
            self._fReady = True
            return True
        if message[0] == 'done' and len(message) == 5:
            _tag, url, mtime, infos, incomplete = message
            if not (isinstance(url, str) and isinstance(mtime, float | int)
                    and isinstance(infos, dict) and isinstance(incomplete, list)
                    and all(isinstance(k, str) and isinstance(v, scopeinfo.CScopeInfo)
                            for k, v in infos.items())):
                return False
            loc = location.CreateFromName(url)
            if loc in self._fPending:
                self._Store(loc, self._fPending.pop(loc), float(mtime), infos, incomplete)
            return True
        if message[0] == 'problem' and len(message) == 5:
            _tag, url, kind, detail, missing = message
            if not (isinstance(url, str) and isinstance(kind, str) and isinstance(detail, str)):
                return False
            loc = location.CreateFromName(url)
            if self._fPending.pop(loc, None) is not None:
                if missing:
                    self.fAnaMgr.fInfoCache.ForgetFile(loc)
                singleton.GetSingletons().fCacheMgr.fReadProblems[loc] = (kind, detail)
                self._Emit('scan-queue-locs-removed', [loc])
            return True
        return False

    def _Store(self, loc: Any, priority: int, mtime: float, infos: dict[str, Any],
               incomplete: list[str]) -> None:
        """A finished scan: store it and queue what a local scan would have queued."""
        ana_mgr = self.fAnaMgr
        coord = ana_mgr.fScanCoordinator
        cache = ana_mgr.fInfoCache
        cache.ReplaceFileInfos(loc, infos, ana_mgr.fPrimaryScanName, mtime)
        if incomplete:
            coord._fIncompleteScansByLoc[loc] = set(incomplete)
        else:
            coord._fIncompleteScansByLoc.pop(loc, None)
        self.fScanned[loc] = len(infos)
        cache.FinishedWithScans(loc, '*', ana_mgr.fPrimaryScanName)
        self._Emit('scan-queue-locs-removed', [loc])
        imported = [rec[-1] for rec in cache.GetAllImports([loc])]
        coord._CScanCoordinator__AddImportEquivsToQueue(imported, loc.GetParentDir(), priority)
        secondary = ana_mgr.fAnalysisFactory.GetSecondaryLocations(loc)
        if secondary:
            coord.AddPairsToPrimaryQueue([(s, '*') for s in secondary], True, priority)
        coord.AddPairsToSecondaryQueue([(loc, '*')], True, priority)

    # -- gone ------------------------------------------------------------------------

    def _Gone(self, reason: str) -> None:
        """Stop the worker for good and take its unfinished files back."""
        if self.fGoneReason is not None:
            return
        self.fGoneReason = reason
        self._AnnounceNow()  # so that the coordinator knows every file it had
        proc = self.fProcess
        if proc is not None and proc.is_alive():
            proc.kill()
        self._EndProcess()
        self.fHandedBack = len(self._fPending)
        self._fPending.clear()
        self.fAnaMgr.fHelperProcessProxy = None
        coord = self.fAnaMgr.fScanCoordinator
        if coord is not None:
            coord._UpdateForHelperProcess()


# -- the worker --------------------------------------------------------------------


def _WorkerMain(conn: Any, config: dict[str, Any]) -> None:
    """The helper process: scan the files it is sent, highest priority first."""
    signal.signal(signal.SIGINT, signal.SIG_IGN)  # the main process decides when to stop
    import hostapp

    from pysource import scopescanner

    inbox: queue.SimpleQueue = queue.SimpleQueue()

    def read() -> None:
        try:
            while True:
                inbox.put(conn.recv())
        except (EOFError, OSError):
            inbox.put(('quit',))

    threading.Thread(target=read, name='helper-reader', daemon=True).start()
    app = hostapp.CreateApplication(
        config['project_dir'], db_path=None,
        python_path=[location.CreateFromName(url) for url in config['python_path']],
        load_database=False)
    ana_mgr = app.fAnaMgr
    cache_mgr = app.fSingletons.fCacheMgr
    scan_name = config['scan_name']
    conn.send(('ready',))
    heap: list[tuple[int, int, str]] = []
    seq = 0
    while True:
        messages = [] if heap else [inbox.get()]
        while True:
            try:
                messages.append(inbox.get_nowait())
            except queue.Empty:
                break
        for message in messages:
            if message[0] == 'quit':
                return
            if message[0] == 'flush':
                heap.clear()
            elif message[0] == 'add':
                _tag, urls, priority, first = message
                for url in urls:
                    seq += 1
                    heapq.heappush(heap, (priority, -seq if first else seq, url))
        if not heap:
            continue
        _priority, _seq, url = heapq.heappop(heap)
        loc = location.CreateFromName(url)
        incomplete: set[str] = set()
        scanner = scopescanner.CWholeFilePrimaryScanner(loc, scan_name, incomplete,
                                                        ana_mgr=ana_mgr)
        state = scanner.Scan(time.time() + 60)
        while state not in (scopescanner.kFinishedScanning, scopescanner.kScanAbandoned):
            state = scanner.Scan(time.time() + 60)
        if state == scopescanner.kFinishedScanning:
            conn.send(('done', url, scanner.fMTime or 0.0, scanner._fInfos, sorted(incomplete)))
        else:
            kind, detail = cache_mgr.fReadProblems.get(loc, ('unreadable', 'not scanned'))
            conn.send(('problem', url, kind, detail, bool(scanner.fFileDoesntExist)))
        scanner.destroy()
        ana_mgr.fInfoCache.ForgetFile(loc)
        ana_mgr.fInfoCache.Trim()
