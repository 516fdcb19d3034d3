"""CScanCoordinator: construction, fields, signal handlers, idle scheduling,
suspension, quitting and destruction.

Every test that takes `coord` or `coord_cls` runs twice: on the class itself and
on CountingCoordinator, a Python subclass that records the calls of its
overridable operations and delegates them; on the latter the tests also check
that the coordinator's own calls went through the overrides.
"""
import gc
import weakref
from types import SimpleNamespace

import config
import pytest
import singleton
from cache import textcache
from coord_doubles import *
from coord_doubles import (
    IDLE_PRIORITY,
    PRIMARY,
    Boom,
    CallLog,
    ClassConnectSpy,
    CoordHost,
    CountingCoordinator,
    CScanCoordinator,
    FakeAnalysis,
    FakeAnalysisMgr,
    FakeCacheMgr,
    analysis_idles,
    counted,
    instance_connections,
    local,
    make_coord,
    pending_idle,
    queued,
    record_signals,
    remote,
    waiting,
)
from guiutils import ostrelgtk
from ostrelbase import containers, destroyable, remoteclient

from pysource import _fastaccess, analysis, scancoordinator

A = local('a.py')
B = local('b.py')
C = local('c.py')
R = remote('r.py')  # never made ready: its scans wait for inspection

P = '_CScanCoordinator__'  # prefix of the class-private fields

# Every field after the base class's, with its value in a new coordinator; the
# ones with a per-instance or defaulting value are checked separately.
kInitialValues = {
    f'{P}fActiveLoc': None,
    f'{P}fActivePrimaryWholeFileScanners': {},
    f'{P}fActivePrimarySingleScopeScanners': {},
    f'{P}fActiveSecondaryWholeFileScanners': {},
    f'{P}fActiveSecondarySingleScopeScanners': {},
    '_fCompletedScanCount': {},
    '_fIdleProcId': None,
    '_fMTimeAtLastWholeFileCheck': {},
    'fIdlePriority': IDLE_PRIORITY,
    f'{P}fCompletedLocs': set(),
    f'{P}fStatusTimeout': None,
    '_fLastScanCompleted': {},
    f'{P}fQuitting': False,
    '_fAllBasicModuleQueued': False,
    '_fAnalyzeFoundImports': True,
    '_fRemoteLocationsReady': set(),
    '_fActiveScanNowTriples': set(),
    '_fPendingScanNowTriples': set(),
    'fActiveScanItem': None,
    '_fActiveIdleStart': -1.0,
    '_fLastLogQueue': -1.0,
    'fWaitingForRemote': False,
    '_fLocsQueuedInHelper': set(),
    '_fIdleToWriteToDatabase': None,
    '_fHelperCallbackObjConnected': None,
    '_fIdleScanSuspendCount': 0,
}

kAllFields = ['fAnaMgr', '_fInfoCache', '_fInferenceEngine', 'fPrefMgr', 'fCacheMgr',
              'fSingletons', '_fScanQueue', '_fIncompleteScansByLoc',
              '_fScanTripleCompletedCount', 'fLog', *kInitialValues]

kContainerFields = [name for name in kAllFields
                    if isinstance(kInitialValues.get(name), (dict, set))] + [
    '_fIncompleteScansByLoc', '_fScanTripleCompletedCount']


def end_and_scheduled(log):
    return [(c.what, c.kwargs.get('state')) for c in log.find('signal')]


# ---- construction and fields --------------------------------------------------------

def test_initial_field_values(coord, host):
    sing = singleton.GetSingletons()
    assert coord.fAnaMgr is host.fAnaMgr
    assert coord._fInfoCache is host.fInfoCache
    assert coord._fInferenceEngine is host.fAnaMgr.fInferenceEngine
    assert coord.fSingletons is sing
    assert coord.fPrefMgr is host.fPrefMgr
    assert coord.fCacheMgr is host.fCacheMgr

    q = coord._fScanQueue
    assert type(q) is scancoordinator._CScanQueue
    assert q._fLocationDataCache is host.fDataCache
    assert q._CDestroyable__fDestroyed is False

    wrong = {name: getattr(coord, name) for name, value in kInitialValues.items()
             if type(getattr(coord, name)) is not type(value) or getattr(coord, name) != value}
    assert wrong == {}

    assert isinstance(coord.fLog, _fastaccess.CLogger)
    assert coord.fLog.fCategory == 'IdleAnalysis'

    incomplete = coord._fIncompleteScansByLoc
    assert len(incomplete) == 0
    assert incomplete[A] == set() and type(incomplete[A]) is set  # a missing key defaults
    del incomplete[A]
    counts = coord._fScanTripleCompletedCount
    assert len(counts) == 0
    assert counts[(A, '*', PRIMARY)] == 0
    del counts[(A, '*', PRIMARY)]

    # The base class's own fields are untouched.
    assert coord._CDestroyable__fDestroyed is False


def test_container_fields_are_the_coordinators_own_objects(coord_cls, host):
    first = make_coord(coord_cls, host)
    second = make_coord(coord_cls, host)
    for name in kContainerFields:
        # Reading a field gives the object itself, every time...
        assert getattr(first, name) is getattr(first, name), name
        # ...and no two coordinators share one.
        assert getattr(first, name) is not getattr(second, name), name
    assert first._fScanQueue is not second._fScanQueue
    first.destroy()
    second.destroy()


def test_managers_are_taken_from_the_singletons_at_construction(coord, host):
    old_cache_mgr = coord.fCacheMgr
    singleton.SetSingleton('fCacheMgr', FakeCacheMgr(CallLog()))
    assert coord.fCacheMgr is old_cache_mgr


def test_fields_are_read_only(coord):
    sentinel = object()
    writable, deletable = [], []
    for name in kAllFields:
        if name == '_fAnalyzeFoundImports':
            continue
        before = getattr(coord, name)
        try:
            setattr(coord, name, sentinel)
        except AttributeError:
            pass
        else:
            writable.append(name)
            continue
        try:
            delattr(coord, name)
        except AttributeError:
            pass
        else:
            deletable.append(name)
            continue
        after = getattr(coord, name)
        assert after is before or (type(after) is type(before) and after == before), name
    assert writable == []
    assert deletable == []


def test_analyze_found_imports_takes_the_truth_value(coord):
    for value, expected in ((0, False), ('yes', True), ([], False), (object(), True),
                            (None, False), (True, True)):
        coord._fAnalyzeFoundImports = value
        assert coord._fAnalyzeFoundImports is expected, value

    class Undecided:
        def __bool__(self):
            raise Boom('no truth value')

    with pytest.raises(Boom):
        coord._fAnalyzeFoundImports = Undecided()
    assert coord._fAnalyzeFoundImports is True
    with pytest.raises(NotImplementedError):
        del coord._fAnalyzeFoundImports
    assert coord._fAnalyzeFoundImports is True


def test_constructor_argument_counts_and_keywords(coord_cls, host):
    for args in ((), (IDLE_PRIORITY,), (IDLE_PRIORITY, host.fAnaMgr, None)):
        with pytest.raises(TypeError):
            coord_cls(*args)
    with pytest.raises(TypeError):
        coord_cls(IDLE_PRIORITY, host.fAnaMgr, bogus=1)
    with pytest.raises(TypeError):
        coord_cls(IDLE_PRIORITY, ana_mgr=host.fAnaMgr, idle_priority=3)
    # Nothing was connected to the host by the failed calls.
    assert not host.fDataCache._CDestroyable__fSignalCatchers

    c = coord_cls(ana_mgr=host.fAnaMgr, idle_priority=7)
    assert c.fIdlePriority == 7
    assert c.fAnaMgr is host.fAnaMgr
    c.destroy()


@pytest.mark.parametrize('bad', ['5', 1.5, None, [1]])
def test_idle_priority_must_be_an_integer(coord_cls, host, bad):
    with pytest.raises(TypeError):
        coord_cls(bad, host.fAnaMgr)


def test_idle_priority_is_converted_to_int(coord_cls, host):
    class Index:
        def __index__(self):
            return 42

    for value, expected in ((Index(), 42), (True, 1), (-3, -3)):
        c = coord_cls(value, host.fAnaMgr)
        assert type(c.fIdlePriority) is int
        assert c.fIdlePriority == expected
        c.destroy()


@pytest.mark.parametrize('bad', [object(), 'cache', SimpleNamespace(connect=print),
                                 destroyable.CDestroyable(('needs-scan-added',))])
def test_info_cache_of_another_type_is_rejected(coord_cls, host, bad):
    host.fAnaMgr.fInfoCache = bad
    with pytest.raises(TypeError):
        coord_cls(IDLE_PRIORITY, host.fAnaMgr)
    # Rejected before the scan queue was made (it would connect to the data cache).
    assert not host.fDataCache._CDestroyable__fSignalCatchers


def test_info_cache_none_passes_the_type_check(coord_cls, host):
    # None is an accepted value of the field; connecting to it then fails.
    host.fAnaMgr.fInfoCache = None
    with pytest.raises(AttributeError):
        coord_cls(IDLE_PRIORITY, host.fAnaMgr)


def test_constructor_errors_of_collaborators_propagate(coord_cls, host):
    err = Boom('no data cache')

    class BrokenAnaMgr(FakeAnalysisMgr):
        @property
        def fLocationDataCache(self):
            raise err

        @fLocationDataCache.setter
        def fLocationDataCache(self, value):
            pass

    mgr = host.fAnaMgr
    broken = BrokenAnaMgr(mgr.fLog, mgr.fInfoCache, host.fDataCache, mgr.fAnalysisFactory,
                          [local('lib')])
    with pytest.raises(Boom) as info:
        coord_cls(IDLE_PRIORITY, broken)
    assert info.value is err


@pytest.mark.parametrize('remote_support', [True, False])
def test_constructor_connections_in_order(coord_cls, host, monkeypatch, remote_support):
    monkeypatch.setattr(config, 'kAvailRemoteSupport', remote_support)
    spy = ClassConnectSpy(monkeypatch)
    c = make_coord(coord_cls, host)

    made = spy.Connections(c)
    made += instance_connections(c._fScanQueue, 'queue', c)
    made += instance_connections(host.fModFileCache, 'mod_file_cache', c)
    made += instance_connections(host.fSavableMgr, 'savable_mgr', c)
    made += instance_connections(host.fInfoCache, 'info_cache', c)
    made += instance_connections(host.fFactory, 'factory', c)
    got = [(i.emitter, i.signal, i.handler, i.owner) for i in sorted(made)]

    server_conns = [
        ('CRemoteServerManager', 'server-stopped', 'NoArg(on_server_changed)', 'coord'),
        ('CContainerInspectorManager', 'server-stopped', 'NoArg(on_server_changed)', 'coord'),
    ]
    expected = [
        ('queue', 'locations-added', 'self._CB_QueueLocationsAdded', 'coord'),
        ('mod_file_cache', 'suspend', 'NoArg(on_mod_cache_suspend)', 'coord'),
        ('mod_file_cache', 'unsuspend', 'NoArg(on_mod_cache_unsuspend)', 'coord'),
        ('CPySourceAnalysis', 'modified', 'on_modified', 'coord'),
        ('savable_mgr', 'external-files-changed', 'on_external_mod', None),
        ('CTextCache', 'text-modified', 'on_buffer_change', 'coord'),
        ('CPySourceAnalysis', 'active-edit-lineno-changed',
         'self._CB_ActiveEditLinenoChanged', 'coord'),
        *(server_conns if remote_support else []),
        ('info_cache', 'needs-scan-added', 'self._CB_NeedsScanAdded', None),
        ('factory', 'import-resolution-changed', 'NoArg(on_import_resolution_changed)', None),
    ]
    assert got == expected
    assert not any(i.ended for i in made)
    c.destroy()


# ---- quitting -------------------------------------------------------------------------

def test_quitting_is_one_way_and_leaves_the_idle_alone(coord, host):
    coord._ScheduleIdle()
    sid = coord._fIdleProcId
    assert coord.Quitting() is None
    assert coord._CScanCoordinator__fQuitting is True
    # The idle callback stops by itself at its next run; nothing is cancelled here.
    assert coord._fIdleProcId == sid and pending_idle(sid) is not None
    coord.Quitting()
    coord.FlushQueue()
    coord.SuspendIdleScans()
    coord.ResumeIdleScans()
    assert coord._CScanCoordinator__fQuitting is True


# ---- idle scheduling ------------------------------------------------------------------

def test_schedule_idle_installs_one_idle_callback(coord, host, gtk_spy):
    record_signals(coord, host.fLog, 'scheduled', 'end', probe=lambda: coord._fIdleProcId)
    # No work needs to be queued: scheduling depends only on suspension and the path.
    assert coord._ScheduleIdle() is None

    adds = gtk_spy.IdleAdds()
    assert len(adds) == 1
    sid = adds[0].kwargs['result']
    assert coord._fIdleProcId == sid
    src = pending_idle(sid)
    assert src is not None
    assert src.fCallback == coord._CB_DoIdleAnalysis
    assert src.fArgs == ()
    assert src.fPriority == IDLE_PRIORITY
    # The id is stored before "scheduled" is emitted.
    assert end_and_scheduled(host.fLog) == [('scheduled', sid)]

    coord._ScheduleIdle()
    coord._ScheduleIdle()
    assert len(gtk_spy.IdleAdds()) == 1
    assert len(analysis_idles(coord)) == 1
    assert end_and_scheduled(host.fLog) == [('scheduled', sid)]


def test_idle_priority_is_handed_to_the_main_loop(coord_cls, host):
    c = make_coord(coord_cls, host, idle_priority=-7)
    c._ScheduleIdle()
    assert pending_idle(c._fIdleProcId).fPriority == -7
    c.destroy()


def test_schedule_idle_does_nothing_while_suspended_or_without_python_path(coord, host,
                                                                          gtk_spy):
    record_signals(coord, host.fLog, 'scheduled', 'end')
    coord.AddPairsToPrimaryQueue([(A, 'f')])
    coord._CancelIdle()
    host.fLog.clear()

    coord.SuspendIdleScans()
    coord._ScheduleIdle()
    assert coord._fIdleProcId is None
    coord.ResumeIdleScans()
    coord._CancelIdle()
    host.fLog.clear()

    for empty in ([], (), set()):
        host.SetPythonPath(empty)
        coord._ScheduleIdle()
        coord.AddPairsToPrimaryQueue([(B, 'g')])
    assert coord._fIdleProcId is None
    assert gtk_spy.IdleAdds() == []
    assert host.fLog.find('signal') == []
    assert analysis_idles(coord) == []

    host.SetPythonPath([local('lib')])
    coord._ScheduleIdle()
    assert coord._fIdleProcId is not None
    assert [c.what for c in host.fLog.find('signal')] == ['scheduled']


def test_cancel_idle_removes_it_and_emits_end(coord, host, gtk_spy):
    record_signals(coord, host.fLog, 'scheduled', 'end', probe=lambda: coord._fIdleProcId)
    assert coord._CancelIdle() is None  # nothing scheduled: nothing happens
    assert host.fLog.find('gtk', 'idle_remove') == []
    assert host.fLog.find('signal') == []

    coord._ScheduleIdle()
    sid = coord._fIdleProcId
    host.fLog.clear()
    coord._CancelIdle()
    assert [(c.who, c.what) for c in host.fLog] == [('gtk', 'idle_remove'), ('signal', 'end')]
    assert host.fLog.args('gtk', 'idle_remove') == [(sid,)]
    assert end_and_scheduled(host.fLog) == [('end', None)]  # cleared before "end"
    assert coord._fIdleProcId is None
    assert pending_idle(sid) is None

    host.fLog.clear()
    coord._CancelIdle()
    assert host.fLog == []

    coord._ScheduleIdle()
    assert coord._fIdleProcId is not None and coord._fIdleProcId != sid
    assert len(analysis_idles(coord)) == 1


# ---- suspension -----------------------------------------------------------------------

def test_nested_suspension(coord, host, gtk_spy):
    coord.AddPairsToPrimaryQueue([(A, 'f')])
    sid = coord._fIdleProcId
    assert sid is not None
    record_signals(coord, host.fLog, 'scheduled', 'end')

    assert coord.SuspendIdleScans() is None
    assert coord._fIdleScanSuspendCount == 1
    assert coord._fIdleProcId is None and pending_idle(sid) is None
    coord.SuspendIdleScans()
    assert coord._fIdleScanSuspendCount == 2
    assert [c.what for c in host.fLog.find('signal')] == ['end']

    assert coord.ResumeIdleScans() is None
    assert coord._fIdleScanSuspendCount == 1
    coord.AddPairsToPrimaryQueue([(B, 'g')])
    assert coord._fIdleProcId is None

    if counted(coord, 'QueuesEmpty') is not None:
        coord.fCalls.clear()
    coord.ResumeIdleScans()
    assert coord._fIdleScanSuspendCount == 0
    assert coord._fIdleProcId is not None
    assert [c.what for c in host.fLog.find('signal')] == ['end', 'scheduled']
    if counted(coord, 'QueuesEmpty') is not None:
        assert coord.Called('QueuesEmpty') == [(False,)]
        assert coord.Called('_ScheduleIdle') == [()]
        assert counted(coord, '_CancelIdle') == []


def test_suspend_goes_through_cancel_idle(coord):
    coord.SuspendIdleScans()
    coord.SuspendIdleScans()
    if counted(coord, '_CancelIdle') is not None:
        assert coord.Called('_CancelIdle') == [(), ()]
    assert coord._fIdleScanSuspendCount == 2


def test_resume_with_empty_queues_schedules_nothing(coord, host, gtk_spy):
    coord.SuspendIdleScans()
    coord.ResumeIdleScans()
    assert coord._fIdleScanSuspendCount == 0
    assert coord._fIdleProcId is None
    assert gtk_spy.IdleAdds() == []
    if counted(coord, 'QueuesEmpty') is not None:
        assert coord.Called('QueuesEmpty') == [(False,)]
        assert coord.Called('_ScheduleIdle') == []


def test_resume_counts_helper_work_but_not_waiting_work(coord, host, gtk_spy):
    coord.AddPairsToPrimaryQueue([(R, '*')])
    assert waiting(coord) and not queued(coord)
    coord.SuspendIdleScans()
    coord.ResumeIdleScans()
    assert coord._fIdleProcId is None  # parked work alone does not resume scanning

    host.UseHelper()
    coord.AddPairsToPrimaryQueue([(A, '*')])
    assert coord._fLocsQueuedInHelper == {A}
    assert coord._fIdleProcId is None
    coord.SuspendIdleScans()
    coord.ResumeIdleScans()
    assert coord._fIdleProcId is not None  # work in the helper counts


def test_resume_below_zero_keeps_scanning_off(coord, host, gtk_spy):
    coord.AddPairsToPrimaryQueue([(A, 'f')])
    coord._CancelIdle()

    coord.ResumeIdleScans()
    assert coord._fIdleScanSuspendCount == -1
    assert type(coord._fIdleScanSuspendCount) is int
    assert coord._fIdleProcId is None
    coord._ScheduleIdle()
    coord.AddPairsToPrimaryQueue([(B, 'g')])
    assert coord._fIdleProcId is None

    coord.SuspendIdleScans()  # back to 0; suspending never schedules
    assert coord._fIdleScanSuspendCount == 0
    assert coord._fIdleProcId is None
    coord._ScheduleIdle()
    assert coord._fIdleProcId is not None


# ---- signal handlers made by the constructor ---------------------------------------------

def seed_last_scans(coord, *locs):
    for i, loc in enumerate(locs):
        coord._fLastScanCompleted[loc] = {('*', PRIMARY): 100.0 + i}
        coord._fMTimeAtLastWholeFileCheck[loc] = 10.0 + i


def test_module_cache_suspension_sets_waiting_for_remote(coord, host):
    cache = host.fModFileCache
    cache.emit('suspend', cache)
    assert coord.fWaitingForRemote is True
    cache.emit('suspend')  # arguments are ignored
    assert coord.fWaitingForRemote is True
    cache.emit('unsuspend', cache, 'extra')
    assert coord.fWaitingForRemote is False
    cache.emit('unsuspend', cache)
    assert coord.fWaitingForRemote is False


def test_modified_analysis_clears_last_scan_info_of_its_file(coord, host):
    seed_last_scans(coord, A, B, C)
    fake = FakeAnalysis(A, host.fLog)
    fake.emit('modified', fake)
    assert set(coord._fLastScanCompleted) == {B, C}
    assert set(coord._fMTimeAtLastWholeFileCheck) == {B, C}

    # Any analysis object counts, the host's own class included.
    plain = analysis.CPySourceAnalysis(B, host.fAnaMgr)
    plain.NotifyModified()
    assert set(coord._fLastScanCompleted) == {C}
    assert set(coord._fMTimeAtLastWholeFileCheck) == {C}

    FakeAnalysis(local('never.py'), host.fLog).NotifyModified()
    assert set(coord._fLastScanCompleted) == {C}


@pytest.mark.parametrize('make_arg', [set, frozenset, list, lambda locs: dict.fromkeys(locs, 1.0)],
                         ids=['set', 'frozenset', 'list', 'dict'])
def test_external_changes_forget_the_last_scans(coord, host, make_arg):
    seed_last_scans(coord, A, B)
    mtimes = dict(coord._fMTimeAtLastWholeFileCheck)
    host.fSavableMgr.emit('external-files-changed', host.fSavableMgr, make_arg([A, C]))
    assert set(coord._fLastScanCompleted) == {B}
    assert coord._fMTimeAtLastWholeFileCheck == mtimes  # only the scan times go


def test_buffer_change_forgets_the_last_scan_of_its_file(coord, host):
    seed_last_scans(coord, A, B)
    mtimes = dict(coord._fMTimeAtLastWholeFileCheck)
    buf = textcache.CTextCache(A, 'x = 1\n')
    buf.emit('text-modified', buf, 'further', 'arguments')
    assert set(coord._fLastScanCompleted) == {B}
    assert coord._fMTimeAtLastWholeFileCheck == mtimes

    buf.SetText('x = 2\n')  # already gone: nothing changes
    textcache.CTextCache(C).SetText('never scanned\n')
    assert set(coord._fLastScanCompleted) == {B}
    buf.destroy()


@pytest.mark.parametrize('server_cls', [remoteclient.CRemoteServerManager,
                                        containers.CContainerInspectorManager])
def test_server_stop_forgets_ready_remote_locations(coord, server_cls, tmp_path):
    coord._fRemoteLocationsReady.update({R, remote('s.py')})
    server = server_cls('build-host', str(tmp_path))
    server.emit('server-stopped', server)
    assert coord._fRemoteLocationsReady == set()
    server.destroy()


def test_without_remote_support_server_stops_are_not_followed(coord_cls, host, monkeypatch,
                                                              tmp_path):
    monkeypatch.setattr(config, 'kAvailRemoteSupport', False)
    c = make_coord(coord_cls, host)
    c._fRemoteLocationsReady.add(R)
    for cls in (remoteclient.CRemoteServerManager, containers.CContainerInspectorManager):
        server = cls('build-host', str(tmp_path))
        server.emit('server-stopped', server)
        server.destroy()
    assert c._fRemoteLocationsReady == {R}
    c.destroy()


def test_import_resolution_change_without_python_path_removes_the_idle(coord, host, gtk_spy):
    record_signals(coord, host.fLog, 'scheduled', 'end', probe=lambda: coord._fIdleProcId)
    coord.AddPairsToPrimaryQueue([(A, 'f')])
    sid = coord._fIdleProcId
    host.fLog.clear()

    host.SetPythonPath([])
    host.fFactory.emit('import-resolution-changed', host.fFactory)
    assert coord._fIdleProcId is None
    assert pending_idle(sid) is None
    assert host.fLog.args('gtk', 'idle_remove') == [(sid,)]
    assert end_and_scheduled(host.fLog) == [('end', None)]
    assert queued(coord) == {(A, 'f', PRIMARY): 1}  # the work itself stays queued

    host.fLog.clear()
    host.fFactory.emit('import-resolution-changed', host.fFactory)
    assert host.fLog.find('gtk') == [] and host.fLog.find('signal') == []


def test_import_resolution_change_with_python_path_schedules_queued_work(coord, host,
                                                                        gtk_spy):
    host.SetPythonPath([])
    coord.AddPairsToPrimaryQueue([(A, 'f')])
    assert coord._fIdleProcId is None

    host.SetPythonPath([local('lib')])
    host.fFactory.emit('import-resolution-changed')
    assert coord._fIdleProcId is not None
    assert len(analysis_idles(coord)) == 1
    if counted(coord, '_ScheduleIdle') is not None:
        assert len(coord.Called('_ScheduleIdle')) == 2  # the add's, then the handler's


def test_import_resolution_change_counts_waiting_work(coord, host, gtk_spy):
    host.SetPythonPath([])
    coord.AddPairsToPrimaryQueue([(R, '*')])
    assert waiting(coord) and coord._fIdleProcId is None
    host.SetPythonPath([local('lib')])
    host.fFactory.emit('import-resolution-changed', host.fFactory)
    assert coord._fIdleProcId is not None


def test_import_resolution_change_with_nothing_queued_schedules_nothing(coord, host,
                                                                       gtk_spy):
    host.fFactory.emit('import-resolution-changed', host.fFactory)
    # Work handed to the helper process is not in the scan queue.
    host.UseHelper()
    coord.AddPairsToPrimaryQueue([(A, '*')])
    assert coord._fLocsQueuedInHelper == {A}
    host.fFactory.emit('import-resolution-changed', host.fFactory)
    assert coord._fIdleProcId is None
    assert gtk_spy.IdleAdds() == []
    if counted(coord, '_ScheduleIdle') is not None:
        assert coord.Called('_ScheduleIdle') == []


# ---- destruction ------------------------------------------------------------------------

def test_destroy_cancels_the_idle_and_destroys_the_queue(coord, host, gtk_spy):
    coord.AddPairsToPrimaryQueue([(A, 'f'), (B, '*')])
    sid = coord._fIdleProcId
    q = coord._fScanQueue
    record_signals(coord, host.fLog, 'end', probe=lambda: coord._fIdleProcId)
    if counted(coord, '_CancelIdle') is not None:
        coord.fCalls.clear()

    assert coord.destroy() is None
    assert coord._fIdleProcId is None
    assert pending_idle(sid) is None
    assert analysis_idles(coord) == []
    assert end_and_scheduled(host.fLog) == [('end', None)]
    assert coord._CScanCoordinator__fStatusTimeout is None
    assert host.fLog.find('gtk', 'timeout_remove') == []  # there was no status timeout

    assert coord._fScanQueue is q
    assert q._CDestroyable__fDestroyed is True
    assert q._fPerLocationInfo == {} and q._fOrderedQueues == []
    # The queue's connections to the data cache ended with it.
    assert all(i.ended for i in instance_connections(host.fDataCache, 'data_cache', coord))
    if counted(coord, '_CancelIdle') is not None:
        assert coord.Called('_destroy_impl') == [()]
        assert coord.Called('_CancelIdle') == [()]


def test_destroy_removes_the_status_timeout(coord, host, gtk_spy):
    coord.AddPairsToPrimaryQueue([(A, 'f')])
    coord._CScanCoordinator__EnsureStatusTimeout()
    tid = coord._CScanCoordinator__fStatusTimeout
    assert tid is not None and ostrelgtk.GetMainLoop().has_source(tid)

    coord.destroy()
    assert host.fLog.args('gtk', 'timeout_remove') == [(tid,)]
    assert not ostrelgtk.GetMainLoop().has_source(tid)
    assert coord._CScanCoordinator__fStatusTimeout == tid  # the field keeps its value


def test_destroy_ends_owned_connections_and_keeps_plain_ones(coord, host, tmp_path):
    coord.destroy()
    seed_last_scans(coord, A, B, C)
    coord._fRemoteLocationsReady.add(R)
    coord._fIncompleteScansByLoc[A] = {'f', 'g'}

    host.fModFileCache.emit('suspend', host.fModFileCache)
    FakeAnalysis(A, host.fLog).NotifyModified()
    buf = textcache.CTextCache(B)
    buf.emit('text-modified', buf)
    server = remoteclient.CRemoteServerManager('build-host', str(tmp_path))
    server.emit('server-stopped', server)
    FakeAnalysis(A, host.fLog).SetActiveEditLineno(3)
    q = coord._fScanQueue
    assert coord.fWaitingForRemote is False
    assert set(coord._fLastScanCompleted) == {A, B, C}
    assert coord._fRemoteLocationsReady == {R}
    assert queued(coord) == {}
    assert all(i.ended for i in instance_connections(host.fModFileCache, 'mod', coord))
    assert all(i.ended for i in instance_connections(q, 'queue', coord))

    # The three plain connections outlive the coordinator.
    host.fSavableMgr.emit('external-files-changed', host.fSavableMgr, {C})
    assert set(coord._fLastScanCompleted) == {A, B}
    kept = [(i.signal, i.handler, i.ended)
            for emitter in (host.fSavableMgr, host.fInfoCache, host.fFactory)
            for i in instance_connections(emitter, 'emitter', coord)]
    assert kept == [('external-files-changed', 'on_external_mod', False),
                    ('needs-scan-added', 'self._CB_NeedsScanAdded', False),
                    ('import-resolution-changed', 'NoArg(on_import_resolution_changed)', False)]
    buf.destroy()
    server.destroy()


@pytest.mark.parametrize('cls', [CScanCoordinator, CountingCoordinator],
                         ids=['class', 'counting-subclass'])
def test_coordinator_held_by_its_analysis_manager_is_freed(cls):
    h = CoordHost().Install()
    c = make_coord(cls, h)
    h.fAnaMgr.fScanCoordinator = c  # the usual cycle: manager <-> coordinator
    c.AddPairsToPrimaryQueue([(A, 'f'), (B, '*')])
    c.AddPairsToSecondaryQueue([(C, 'g')])
    seed_last_scans(c, A)
    c._fIncompleteScansByLoc[A] = {'f'}
    record_signals(c, h.fLog, 'scheduled', 'end')
    ref = weakref.ref(c)
    mgr_ref = weakref.ref(h.fAnaMgr)

    c.destroy()
    singleton.ResetSingletons()
    del c, h
    gc.collect()
    assert ref() is None
    assert mgr_ref() is None

