"""CScanCoordinator: construction and fields, the signal handlers made by the
constructor, idle scheduling, suspension, quitting and destruction."""
import gc
import weakref
from types import SimpleNamespace

import config
import pytest
import singleton
from cache import textcache
from coord_doubles import *
from guiutils import ostrelgtk
from ostrelbase import containers, destroyable, remoteclient

from pysource import _fastaccess, analysis

A, B, C = local('a.py'), local('b.py'), local('c.py')
R = remote('r.py')  # never made ready: its scans wait for inspection
P = '_CScanCoordinator__'


def test_fields(coord, host):
    assert (coord.fAnaMgr, coord._fInfoCache, coord._fInferenceEngine, coord.fCacheMgr) == (
        host.fAnaMgr, host.fInfoCache, host.fEngine, host.fCacheMgr)
    assert coord._fScanQueue._fLocationDataCache is host.fDataCache
    assert type(coord.fLog) is _fastaccess.CLogger and coord.fLog.fCategory == 'IdleAnalysis'
    # Both defaulting dictionaries make and keep an entry for a missing key.
    assert coord._fIncompleteScansByLoc[A] == set() and A in coord._fIncompleteScansByLoc
    assert coord._fScanTripleCompletedCount[(A, '*', PRIMARY)] == 0
    for name in ('fAnaMgr', '_fScanQueue', '_fIdleProcId', f'{P}fQuitting', 'fLog'):
        with pytest.raises(AttributeError):
            setattr(coord, name, None)
def test_found_imports_flag_is_writable(coord):
    for value, expected in ((0, False), ('yes', True), ([], False)):
        coord._fAnalyzeFoundImports = value
        assert coord._fAnalyzeFoundImports is expected

    class Undecided:
        def __bool__(self):
            raise Boom('no truth value')

    with pytest.raises(Boom):
        coord._fAnalyzeFoundImports = Undecided()
    with pytest.raises(NotImplementedError):
        del coord._fAnalyzeFoundImports
    assert coord._fAnalyzeFoundImports is False


def test_constructor_arguments(host):
    for args, kwargs in [((), {}), ((1, host.fAnaMgr, None), {}), ((1, host.fAnaMgr), {'x': 1}),
                         (('5', host.fAnaMgr), {}), ((1.5, host.fAnaMgr), {})]:
        with pytest.raises(TypeError):
            CScanCoordinator(*args, **kwargs)
    c = CScanCoordinator(ana_mgr=host.fAnaMgr, idle_priority=True)
    assert type(c.fIdlePriority) is int and c.fIdlePriority == 1
    for name in ('_CB_WriteToDatabase', '_UpdateForHelperProcess', 'FlushQueue', 'GetStatus'):
        with pytest.raises(TypeError, match=rf'^{name}\(\) takes exactly 0 positional'):
            getattr(c, name)(1)
    with pytest.raises(TypeError):
        c.TryToScanDictNow(A, 'f', [], 'soon')
    # -1.0 is a time long past, not an error.
    assert c.TryToScanDictNow(A, 'f', [], -1.0) is False and c.TryToScanNow(A, 'f', [], -1.0) is None
    assert host.fLog == [] and c.QueuesEmpty()
    c.destroy()
    with pytest.raises(RuntimeError, match=r'^CScanCoordinator.__init__\(\) has not been called$'):
        CScanCoordinator.__new__(CScanCoordinator).QueuesEmpty()


@pytest.mark.parametrize('bad, exc', [(object(), TypeError),
                                      (destroyable.CDestroyable(('needs-scan-added',)), TypeError),
                                      (None, AttributeError)])
def test_an_info_cache_of_another_type_is_rejected(host, bad, exc):
    host.fAnaMgr.fInfoCache = bad
    with pytest.raises(exc):
        CScanCoordinator(IDLE_PRIORITY, host.fAnaMgr)
    # A wrong type is rejected before the scan queue connects to the data cache.
    assert bool(host.fDataCache._CDestroyable__fSignalCatchers) is (exc is AttributeError)


def test_quitting_is_one_way_and_leaves_the_idle_alone(coord):
    coord._ScheduleIdle()
    sid = coord._fIdleProcId
    assert coord.Quitting() is None
    coord.FlushQueue()
    coord.SuspendIdleScans()
    coord.ResumeIdleScans()
    assert coord._CScanCoordinator__fQuitting is True
    coord._ScheduleIdle()
    assert ostrelgtk.GetMainLoop().has_source(coord._fIdleProcId) and coord._fIdleProcId != sid


def test_schedule_idle_installs_one_idle(host):
    coord = make_coord(host, idle_priority=-7)
    record_signals(coord, host.fLog, 'scheduled', 'end', probe=lambda: coord._fIdleProcId)
    assert coord._ScheduleIdle() is None
    coord._ScheduleIdle()
    [src] = pending_callbacks(coord)
    assert (src.fArgs, src.fPriority, coord._fIdleProcId) == ((), -7, src.fId)
    # The id is stored before "scheduled" is emitted, and cleared before "end".
    assert coord._CancelIdle() is None
    coord._CancelIdle()
    assert [(c.what, c.kwargs['state']) for c in host.fLog] == [('scheduled', src.fId),
                                                                 ('end', None)]
    assert pending_callbacks(coord) == []
    coord.destroy()


def test_schedule_idle_does_nothing_while_suspended_or_without_python_path(coord, host):
    coord.SuspendIdleScans()
    coord.AddPairsToPrimaryQueue([(A, 'f')])
    assert coord._fIdleProcId is None
    coord.ResumeIdleScans()
    coord._CancelIdle()
    host.SetPythonPath([])
    coord._ScheduleIdle()
    assert coord._fIdleProcId is None and pending_callbacks(coord) == []
    host.SetPythonPath([local('lib')])
    coord._ScheduleIdle()
    assert coord._fIdleProcId is not None


def test_nested_suspension(coord, host):
    coord.AddPairsToPrimaryQueue([(A, 'f')])
    record_signals(coord, host.fLog, 'scheduled', 'end')
    coord.SuspendIdleScans()
    coord.SuspendIdleScans()
    assert coord._fIdleScanSuspendCount == 2 and pending_callbacks(coord) == []
    coord.ResumeIdleScans()
    coord.AddPairsToPrimaryQueue([(B, 'g')])
    assert coord._fIdleProcId is None
    coord.ResumeIdleScans()
    assert coord._fIdleScanSuspendCount == 0 and len(pending_callbacks(coord)) == 1
    assert signals_of(host.fLog) == ['end', 'scheduled']
    # Resuming below zero keeps scanning off until a suspension brings the count back.
    coord._CancelIdle()
    coord.ResumeIdleScans()
    coord._ScheduleIdle()
    assert coord._fIdleScanSuspendCount == -1 and coord._fIdleProcId is None
    coord.SuspendIdleScans()
    assert coord._fIdleProcId is None
    coord._ScheduleIdle()
    assert coord._fIdleProcId is not None


def test_resume_counts_helper_work_but_not_waiting_work(coord, host):
    coord.AddPairsToPrimaryQueue([(R, '*')])
    coord.SuspendIdleScans()
    coord.ResumeIdleScans()
    assert waiting(coord) and coord._fIdleProcId is None
    host.UseHelper()
    coord.AddPairsToPrimaryQueue([(A, '*')])
    assert coord._fLocsQueuedInHelper == {A} and coord._fIdleProcId is None
    coord.SuspendIdleScans()
    coord.ResumeIdleScans()
    assert coord._fIdleProcId is not None


def seed_last_scans(coord, *locs):
    for i, loc in enumerate(locs):
        coord._fLastScanCompleted[loc] = {('*', PRIMARY): 100.0 + i}
        coord._fMTimeAtLastWholeFileCheck[loc] = 10.0 + i


def test_module_cache_suspension_and_modified_analyses(coord, host):
    host.fModFileCache.emit('suspend', host.fModFileCache)
    assert coord.fWaitingForRemote is True
    host.fModFileCache.emit('unsuspend')
    assert coord.fWaitingForRemote is False
    seed_last_scans(coord, A, B, C)
    Analysis(A, host.fLog).NotifyModified()
    analysis.CPySourceAnalysis(B, host.fAnaMgr).NotifyModified()
    assert set(coord._fLastScanCompleted) == set(coord._fMTimeAtLastWholeFileCheck) == {C}


@pytest.mark.parametrize('make_arg', [set, list, lambda locs: dict.fromkeys(locs, 1.0)])
def test_external_changes_and_edits_forget_the_last_scan_times(coord, host, make_arg):
    seed_last_scans(coord, A, B, C)
    mtimes = dict(coord._fMTimeAtLastWholeFileCheck)
    host.fSavableMgr.emit('external-files-changed', host.fSavableMgr, make_arg([A, local('x')]))
    buf = textcache.CTextCache(B, 'x = 1\n')
    buf.emit('text-modified', buf, 'further', 'arguments')
    buf.SetText('x = 2\n')  # already forgotten: nothing changes
    assert set(coord._fLastScanCompleted) == {C}
    assert coord._fMTimeAtLastWholeFileCheck == mtimes  # only the scan times go
    buf.destroy()


@pytest.mark.parametrize('remote_support', [True, False])
def test_a_server_stop_forgets_the_ready_remote_locations(host, monkeypatch, tmp_path,
                                                          remote_support):
    monkeypatch.setattr(config, 'kAvailRemoteSupport', remote_support)
    coord = make_coord(host)
    for cls in (remoteclient.CRemoteServerManager, containers.CContainerInspectorManager):
        coord._fRemoteLocationsReady.add(R)
        server = cls('build-host', str(tmp_path))
        server.emit('server-stopped', server)
        server.destroy()
        assert coord._fRemoteLocationsReady == (set() if remote_support else {R})
    coord.destroy()


def test_import_resolution_changes(coord, host):
    record_signals(coord, host.fLog, 'scheduled', 'end', probe=lambda: coord._fIdleProcId)
    factory = host.fFactory
    coord.AddPairsToPrimaryQueue([(A, 'f')])
    sid = coord._fIdleProcId
    host.SetPythonPath([])
    factory.emit('import-resolution-changed', factory)
    factory.emit('import-resolution-changed', factory)
    assert pending_callbacks(coord) == [] and queued(coord) == {(A, 'f', PRIMARY): 1}
    assert [(c.what, c.kwargs['state']) for c in host.fLog] == [('scheduled', sid),
                                                                 ('end', None)]
    host.SetPythonPath([local('lib')])
    factory.emit('import-resolution-changed')
    assert len(pending_callbacks(coord)) == 1
    # Parked work counts; work in the helper process does not.
    coord.RemoveLocationsFromQueue([A])
    coord._CancelIdle()
    host.UseHelper()
    coord.AddPairsToPrimaryQueue([(B, '*')])
    factory.emit('import-resolution-changed')
    assert coord._fIdleProcId is None
    coord.AddPairsToPrimaryQueue([(R, '*')])
    coord._CancelIdle()
    factory.emit('import-resolution-changed')
    assert coord._fIdleProcId is not None


def test_destroy_cancels_the_idle_and_the_status_timeout_and_destroys_the_queue(
        coord, host, monkeypatch):
    removed = []
    real = ostrelgtk.timeout_remove
    monkeypatch.setattr(ostrelgtk, 'timeout_remove', lambda sid: removed.append(sid) or real(sid))
    make_coord(host).destroy()  # no status timeout: nothing to remove
    coord.AddPairsToPrimaryQueue([(A, 'f'), (B, '*')])
    coord._CScanCoordinator__EnsureStatusTimeout()
    tid = coord._CScanCoordinator__fStatusTimeout
    q = coord._fScanQueue
    record_signals(coord, host.fLog, 'end', probe=lambda: coord._fIdleProcId)
    assert coord.destroy() is None
    assert pending_callbacks(coord) == [] and coord._fIdleProcId is None
    assert [(c.what, c.kwargs['state']) for c in host.fLog] == [('end', None)]
    assert removed == [tid] and not ostrelgtk.GetMainLoop().has_source(tid)
    assert q._CDestroyable__fDestroyed and q._fPerLocationInfo == {}
    host.fDataCache.MakeReady([R])  # the queue no longer listens
    assert coord._fScanQueue is q and q._fPerLocationInfo == {}


def test_destroy_ends_the_owned_connections_only(coord, host, tmp_path):
    coord.destroy()
    seed_last_scans(coord, A, B, C)
    coord._fRemoteLocationsReady.add(R)
    coord._fIncompleteScansByLoc[A] = {'h'}
    host.fModFileCache.emit('suspend', host.fModFileCache)
    Analysis(A, host.fLog).NotifyModified()
    buf = textcache.CTextCache(B)
    buf.emit('text-modified', buf)
    server = remoteclient.CRemoteServerManager('build-host', str(tmp_path))
    server.emit('server-stopped', server)
    Analysis(A, host.fLog, {3: 'g'}).SetActiveEditLineno(3)
    assert coord.fWaitingForRemote is False and coord._fRemoteLocationsReady == {R}
    assert set(coord._fLastScanCompleted) == {A, B, C}
    # The plain connections outlive the coordinator.
    host.fSavableMgr.emit('external-files-changed', host.fSavableMgr, {C})
    assert set(coord._fLastScanCompleted) == {A, B}
    host.fInfoCache.emit('needs-scan-added', host.fInfoCache, [(A, 'f', PRIMARY)], None)
    assert queued(coord) == {(A, 'f', PRIMARY): 1}
    buf.destroy()
    server.destroy()


def test_a_destroyed_coordinator_in_reference_cycles_is_freed(monkeypatch):
    """Cycles through its analysis manager, its active scanners' handlers (a primary
    scan waiting for data, an unfinished secondary scan) and the helper's callbacks."""
    h = Host().Patch(monkeypatch)
    Callbacks = helper_callback_class()
    h.fAnaMgr._fHelperProcessSupport = SimpleNamespace(fHelperCallbackObj=Callbacks())
    h.UseHelper()
    c = make_coord(h)
    h.fAnaMgr.fScanCoordinator = c
    c._UpdateForHelperProcess()
    h.UseHelper(False)
    h.fScanners.Script(PRIMARY_WHOLE, A, [kWaitingForData])
    h.fScanners.Script(SECONDARY_SCOPE, (B, 'f'), [kReadyToScan])
    c.AddPairsToPrimaryQueue([(A, '*'), (C, 'f')])
    c._CB_DoIdleAnalysis()
    assert c._CScanCoordinator__DoSecondarySingleScopeScan(B, 'f', end_in()) is True
    c._fIncompleteScansByLoc[A] = {'f'}
    record_signals(c, h.fLog, 'scheduled', 'end')
    refs = [weakref.ref(o) for o in (c, h.fAnaMgr, *h.fScanners.Made())]
    assert len(refs) == 4
    c.destroy()
    assert h.fScanners.Made()[0].Connections() == 0
    h.Destroy()
    h.fScanners.fCreated.clear()
    Callbacks.fConnects.clear()
    singleton.ResetSingletons()
    ostrelgtk.reset()
    del c, h
    gc.collect()
    assert [r() for r in refs] == [None] * 4
