"""CScanCoordinator: the queueing interface and the helper-process split.

Covers the priority rule, the primary and secondary queues, the helper process
taking local whole files, needs-scan reports, the caret leaving incomplete
scopes, the builtins and typing modules, parseable files, the queue queries,
removing, flushing, and what bad input and failing collaborators leave behind.

Every test that takes `coord` runs on the class itself and on
CountingCoordinator (see coord_doubles); on the latter it also checks that the
coordinator's own calls of its overridable operations reached the overrides.
What is queued is read from the scan queue's per-location records, which name
the scan and its priority exactly.
"""
import pytest
import singleton
from coord_doubles import *
from coord_doubles import (
    DERIVED,
    PRIMARY,
    Boom,
    CScanCoordinator,
    FakeAnalysis,
    FakeFileAttribMgr,
    analysis_idles,
    counted,
    kBackgroundPriority,
    kInteractivePriority,
    kTypingModulePriority,
    local,
    pending_idle,
    queued,
    record_signals,
    remote,
    waiting,
)
from doubles import FakeLocationDataCache, LocalLocation
from guiutils import ostrelgtk
from ostrelbase import location
from scanqueue_fixtures import check_invariants

from pysource import scancoordinator

A = local('a.py')
B = local('b.py')
C = local('c.py')
D = local('d.py')
E = local('e.py')
F = local('f.py')
R = remote('r.py')  # made ready where a test needs it queued
W = remote('w.py')  # never ready: its scans wait for inspection
PY = 'text/x-python'
OTHER = 'other-scan'


def names_called(coord):
    """The names of the counting coordinator's recorded calls, in order."""
    return [c[0] for c in coord.fCalls]


def whole_files_to_check(coord):
    return list(coord._fScanQueue._fWholeFilesToCheck.items())


@pytest.fixture
def ready_remote(host):
    host.fDataCache.fReady.add(R)


# ---- the priority rule ------------------------------------------------------------------

kPriorityCases = [
    ({}, kInteractivePriority),
    ({'first': True}, kInteractivePriority),
    ({'first': False}, kBackgroundPriority),
    ({'priority': kTypingModulePriority}, kTypingModulePriority),
    ({'first': False, 'priority': 0}, 0),
    ({'first': True, 'priority': 2}, 2),
    ({'priority': 7}, 7),
]


@pytest.mark.parametrize('kwargs, expected', kPriorityCases)
def test_primary_priority_rule(coord, kwargs, expected):
    coord.AddPairsToPrimaryQueue([(A, 'f'), (B, '*')], **kwargs)
    assert queued(coord) == {(A, 'f', PRIMARY): expected, (B, '*', PRIMARY): expected}
    # Primary pairs also register their files for the whole-file check.
    assert whole_files_to_check(coord) == [(A, expected), (B, expected)]
    check_invariants(coord._fScanQueue)


@pytest.mark.parametrize('kwargs, expected', kPriorityCases)
def test_secondary_priority_rule(coord, kwargs, expected):
    coord.AddPairsToSecondaryQueue([(A, 'f'), (B, '*')], **kwargs)
    assert queued(coord) == {(A, 'f', DERIVED): expected, (B, '*', DERIVED): expected}
    assert whole_files_to_check(coord) == []
    check_invariants(coord._fScanQueue)


def test_priority_arguments_by_position(coord):
    coord.AddPairsToPrimaryQueue([(A, 'f')], False)
    coord.AddPairsToPrimaryQueue([(B, 'g')], True, 0)
    coord.AddPairsToSecondaryQueue([(C, 'h')], False)
    coord.AddPairsToSecondaryQueue([(D, 'i')], False, 1)
    assert queued(coord) == {(A, 'f', PRIMARY): 2, (B, 'g', PRIMARY): 0,
                             (C, 'h', DERIVED): 2, (D, 'i', DERIVED): 1}


# ---- the primary queue and the helper process ---------------------------------------------

def test_primary_pairs_without_helper_are_queued_locally(coord, host, gtk_spy, ready_remote):
    record_signals(coord, host.fLog, 'scheduled', probe=lambda: dict(queued(coord)))
    pairs = [(A, '*'), (B, 'g'), (B, 'f'), (R, '*')]
    assert coord.AddPairsToPrimaryQueue(iter(pairs)) is None
    expected = {(A, '*', PRIMARY): 1, (B, 'g', PRIMARY): 1, (B, 'f', PRIMARY): 1,
                (R, '*', PRIMARY): 1}
    assert queued(coord) == expected
    # No helper process: nobody is asked whether a pair could go there.
    assert host.fLog.find('cache_mgr') == []
    assert host.fLog.find('helper') == []
    assert coord._fLocsQueuedInHelper == set()
    # The idle is scheduled once the pairs are in the queue.
    assert [c.kwargs['state'] for c in host.fLog.find('signal', 'scheduled')] == [expected]
    assert len(analysis_idles(coord)) == 1
    if counted(coord, '_ScheduleIdle') is not None:
        assert coord.Called('_CanSendToHelperProcess') == []
        assert names_called(coord) == ['AddPairsToPrimaryQueue', '_ScheduleIdle']


def test_helper_takes_local_unopened_whole_files(coord, host, gtk_spy, ready_remote):
    host.UseHelper()
    host.fCacheMgr.OpenBuffer(B)
    seen = []
    host.fHelper.Probe('AddPairsToPrimaryQueue', lambda *a, **k: seen.append(
        (set(coord._fLocsQueuedInHelper), dict(queued(coord)))))
    pairs = [(A, '*'), (C, 'Cls.m'), (B, '*'), (R, '*'), (D, '*'), (C, '*')]

    coord.AddPairsToPrimaryQueue(pairs, False)

    # The cache manager is asked only about local whole files, in order.
    assert host.fLog.args('cache_mgr', 'DoesCacheBufferExist') == [
        (A, True), (B, True), (D, True), (C, True)]
    calls = host.fLog.find('helper')
    assert [(c.what, c.args, c.kwargs) for c in calls] == [
        ('AddPairsToPrimaryQueue', ([(A, '*'), (D, '*'), (C, '*')], False), {'callback': None})]
    sent = calls[0].args[0]
    assert all(s is p for s, p in zip(sent, [pairs[0], pairs[4], pairs[5]], strict=True))
    assert coord._fLocsQueuedInHelper == {A, D, C}
    # The locations were recorded before the proxy was called, and the local
    # queue was filled afterwards.
    assert seen == [({A, D, C}, {})]
    assert queued(coord) == {(C, 'Cls.m', PRIMARY): 2, (B, '*', PRIMARY): 2,
                             (R, '*', PRIMARY): 2}
    assert len(analysis_idles(coord)) == 1
    if counted(coord, '_ScheduleIdle') is not None:
        assert coord.Called('_CanSendToHelperProcess') == list(pairs)
        assert names_called(coord) == (['AddPairsToPrimaryQueue']
                                       + ['_CanSendToHelperProcess'] * len(pairs)
                                       + ['_ScheduleIdle'])


def test_helper_taking_everything_leaves_queue_and_idle_alone(coord, host, gtk_spy):
    host.UseHelper()
    coord.AddPairsToPrimaryQueue([(A, '*'), (B, '*')], priority=0)
    assert [(c.args, c.kwargs) for c in host.fLog.find('helper')] == [
        (([(A, '*'), (B, '*')], True), {'callback': None})]
    assert coord._fLocsQueuedInHelper == {A, B}
    assert queued(coord) == {}
    assert whole_files_to_check(coord) == []
    assert coord._fIdleProcId is None
    assert gtk_spy.IdleAdds() == []
    if counted(coord, '_ScheduleIdle') is not None:
        assert coord.Called('_ScheduleIdle') == []


def test_can_send_to_helper_process(coord, host):
    class ProjectLocation(location.CLocalFileLocation):
        __slots__ = ()

    host.fCacheMgr.OpenBuffer(B)
    mine = ProjectLocation('/src/mine.py')
    assert coord._CanSendToHelperProcess(A, '*') is True
    assert coord._CanSendToHelperProcess(B, '*') is False  # open in an editor buffer
    assert coord._CanSendToHelperProcess(mine, '*') is True
    assert host.fLog.args('cache_mgr', 'DoesCacheBufferExist') == [
        (A, True), (B, True), (mine, True)]

    host.fLog.clear()
    assert coord._CanSendToHelperProcess(A, 'Cls.m') is False
    assert coord._CanSendToHelperProcess(A, '') is False
    assert coord._CanSendToHelperProcess(R, '*') is False
    assert coord._CanSendToHelperProcess(LocalLocation('a.py'), '*') is False
    assert coord._CanSendToHelperProcess(object(), 'Cls') is False  # the scope is tested first
    assert host.fLog.find('cache_mgr') == []


def test_can_send_to_helper_process_does_not_need_a_helper(coord, host):
    host.UseHelper(False)
    assert coord._CanSendToHelperProcess(A, '*') is True


# ---- the secondary queue ------------------------------------------------------------------

def test_secondary_pairs_are_filtered_by_want_derived_info(coord, host, gtk_spy):
    host.UseHelper()  # never used for secondary scans
    host.fLocCache.fAnswers = {B: 0, C: 'yes', D: ''}
    record_signals(coord, host.fLog, 'scheduled', probe=lambda: dict(queued(coord)))
    pairs = [(A, '*'), (B, '*'), (C, 'f'), (D, 'g'), (E, 'h')]
    assert coord.AddPairsToSecondaryQueue(iter(pairs)) is None

    assert host.fLog.args('loc_cache', 'WantDerivedInfo') == [(A,), (B,), (C,), (D,), (E,)]
    expected = {(A, '*', DERIVED): 1, (C, 'f', DERIVED): 1, (E, 'h', DERIVED): 1}
    assert queued(coord) == expected
    assert whole_files_to_check(coord) == []
    assert host.fLog.find('helper') == [] and host.fLog.find('cache_mgr') == []
    assert coord._fLocsQueuedInHelper == set()
    assert [c.kwargs['state'] for c in host.fLog.find('signal', 'scheduled')] == [expected]
    if counted(coord, '_ScheduleIdle') is not None:
        assert names_called(coord) == ['AddPairsToSecondaryQueue', '_ScheduleIdle']


def test_secondary_pairs_nobody_wants_schedule_nothing(coord, host, gtk_spy):
    host.fLocCache.fAnswers = {A: False, B: None}
    coord.AddPairsToSecondaryQueue([(A, '*'), (B, 'f')])
    coord.AddPairsToSecondaryQueue([])
    assert queued(coord) == {}
    assert coord._fIdleProcId is None
    assert gtk_spy.IdleAdds() == []
    if counted(coord, '_ScheduleIdle') is not None:
        assert coord.Called('_ScheduleIdle') == []


# ---- needs-scan sets and reports -------------------------------------------------------

def test_needs_scan_set_queues_secondary_then_primary(coord, host, gtk_spy):
    host.fCacheMgr.OpenBuffer(B)
    triples = [(A, 'f', PRIMARY), (C, 'h', DERIVED), (B, 'g', PRIMARY), (E, 'x', OTHER),
               (F, 'y', DERIVED)]
    assert coord.AddNeedsScanSetToQueues(triples) is None

    # A file without a buffer is scanned whole; an open one by the reported scope.
    assert queued(coord) == {(A, '*', PRIMARY): 1, (B, 'g', PRIMARY): 1,
                             (C, 'h', DERIVED): 1, (F, 'y', DERIVED): 1}
    assert list(coord._fScanQueue._fPerLocationInfo) == [C, F, A, B]
    assert host.fLog.args('cache_mgr', 'DoesCacheBufferExist') == [(A, True), (B, True)]
    assert whole_files_to_check(coord) == [(A, 1), (B, 1)]
    if counted(coord, '_ScheduleIdle') is not None:
        assert coord.Called('AddPairsToSecondaryQueue') == [([(C, 'h'), (F, 'y')], True, None)]
        assert coord.Called('AddPairsToPrimaryQueue') == [([(A, '*'), (B, 'g')], True, None)]
        names = names_called(coord)
        assert names.index('AddPairsToSecondaryQueue') < names.index('AddPairsToPrimaryQueue')


def test_needs_scan_set_whole_files_may_go_to_the_helper(coord, host):
    host.UseHelper()
    coord.AddNeedsScanSetToQueues({(A, 'f', PRIMARY)})
    assert [c.args for c in host.fLog.find('helper')] == [([(A, '*')], True)]
    assert coord._fLocsQueuedInHelper == {A}
    assert queued(coord) == {}


def test_needs_scan_set_with_other_scans_only_queues_nothing(coord, host, gtk_spy):
    coord.AddNeedsScanSetToQueues({(A, 'f', OTHER), (B, '*', OTHER)})
    coord.AddNeedsScanSetToQueues([])
    assert queued(coord) == {}
    assert host.fLog.find('cache_mgr') == []
    assert coord._fIdleProcId is None
    if counted(coord, '_ScheduleIdle') is not None:
        assert coord.Called('AddPairsToPrimaryQueue') == []
        assert coord.Called('AddPairsToSecondaryQueue') == []


def test_needs_scan_report_groups_by_scan_name_in_first_seen_order(coord, host, gtk_spy):
    host.UseHelper()  # the report goes straight into the scan queue
    triples = [(A, 'f', DERIVED), (B, 'g', PRIMARY), (C, 'h', DERIVED), (E, 'x', OTHER),
               (F, '*', PRIMARY)]
    host.fInfoCache.emit('needs-scan-added', host.fInfoCache, triples, None)

    assert queued(coord) == {(A, 'f', DERIVED): 1, (B, 'g', PRIMARY): 1,
                             (C, 'h', DERIVED): 1, (E, 'x', OTHER): 1,
                             (F, '*', PRIMARY): 1}
    assert list(coord._fScanQueue._fPerLocationInfo) == [A, C, B, F, E]
    assert host.fLog.args('loc_cache', 'WantDerivedInfo') == [(A,), (C,)]
    assert host.fLog.find('cache_mgr') == [] and host.fLog.find('helper') == []
    assert whole_files_to_check(coord) == []
    assert len(analysis_idles(coord)) == 1
    check_invariants(coord._fScanQueue)
    if counted(coord, '_ScheduleIdle') is not None:
        assert coord.Called('_CB_NeedsScanAdded') == [(host.fInfoCache, triples, None)]
        assert names_called(coord) == ['_CB_NeedsScanAdded', '_ScheduleIdle']


@pytest.mark.parametrize('priority, expected', [(None, kInteractivePriority), (0, 0), (2, 2)])
def test_needs_scan_report_priority(coord, host, priority, expected):
    triples = [(A, 'f', PRIMARY), (B, 'g', DERIVED)]
    host.fInfoCache.emit('needs-scan-added', host.fInfoCache, (t for t in triples), priority)
    assert queued(coord) == {(A, 'f', PRIMARY): expected, (B, 'g', DERIVED): expected}


def test_needs_scan_report_drops_unwanted_derived_scans(coord, host):
    host.fLocCache.fAnswers = {A: False}
    coord._CB_NeedsScanAdded(host.fInfoCache,
                             [(A, 'f', DERIVED), (A, 'g', PRIMARY), (B, 'h', DERIVED)], None)
    assert queued(coord) == {(A, 'g', PRIMARY): 1, (B, 'h', DERIVED): 1}
    assert host.fLog.args('loc_cache', 'WantDerivedInfo') == [(A,), (B,)]


def test_needs_scan_report_schedules_even_when_nothing_is_queued(coord, host, gtk_spy):
    host.fLocCache.fAnswers = {A: False}
    assert coord._CB_NeedsScanAdded(host.fInfoCache, [(A, 'f', DERIVED)], None) is None
    assert queued(coord) == {}
    assert coord._fIdleProcId is not None
    coord._CancelIdle()
    coord._CB_NeedsScanAdded(host.fInfoCache, [], 0)
    assert coord._fIdleProcId is not None


# ---- the caret leaving incomplete scopes ------------------------------------------------

def test_caret_leaving_incomplete_scopes_requeues_them(coord, host, gtk_spy):
    coord._fIncompleteScansByLoc[A] = ['g', 'f', 'h']
    coord._fLastScanCompleted[A] = {('f', PRIMARY): 1.0}
    coord._fLastScanCompleted[B] = {('*', PRIMARY): 2.0}
    ana = FakeAnalysis(A, host.fLog, {10: 'f'})

    ana.SetActiveEditLineno(10)

    assert host.fLog.args('analysis', 'FindScopeContainingLine') == [(10,)]
    assert queued(coord) == {(A, 'g', PRIMARY): 1, (A, 'h', PRIMARY): 1}
    assert set(coord._fLastScanCompleted) == {B}
    assert len(analysis_idles(coord)) == 1
    if counted(coord, '_ScheduleIdle') is not None:
        assert coord.Called('_CB_ActiveEditLinenoChanged') == [(ana, 10)]
        assert coord.Called('AddPairsToPrimaryQueue') == [
            ([(A, 'g'), (A, 'h')], True, kInteractivePriority)]


def test_caret_outside_the_file_requeues_every_incomplete_scope(coord, host):
    coord._fIncompleteScansByLoc[A] = ['g', 'f']
    ana = FakeAnalysis(A, host.fLog, {10: 'f'})
    ana.emit('active-edit-lineno-changed', ana, -1)
    assert host.fLog.find('analysis') == []
    assert queued(coord) == {(A, 'g', PRIMARY): 1, (A, 'f', PRIMARY): 1}


def test_caret_in_the_only_incomplete_scope_changes_nothing(coord, host, gtk_spy):
    coord._fIncompleteScansByLoc[A] = {'f'}
    coord._fLastScanCompleted[A] = {('f', PRIMARY): 1.0}
    FakeAnalysis(A, host.fLog, {10: 'f'}).SetActiveEditLineno(10)
    assert queued(coord) == {}
    assert set(coord._fLastScanCompleted) == {A}
    assert coord._fIdleProcId is None
    if counted(coord, '_ScheduleIdle') is not None:
        assert coord.Called('AddPairsToPrimaryQueue') == []


def test_caret_in_a_file_without_incomplete_scopes_changes_nothing(coord, host):
    coord._fLastScanCompleted[B] = {('f', PRIMARY): 1.0}
    coord._CB_ActiveEditLinenoChanged(FakeAnalysis(B, host.fLog, {5: 'f'}), 5)
    assert B not in coord._fIncompleteScansByLoc  # looked up without adding an entry
    assert host.fLog.find('analysis') == []
    assert queued(coord) == {}
    assert set(coord._fLastScanCompleted) == {B}


# ---- the scan queue's "locations-added" ----------------------------------------------------

def test_locations_added_by_the_queue_schedule_the_idle(coord, host, gtk_spy):
    q = coord._fScanQueue
    q.emit('locations-added', q, {A})
    assert coord._fIdleProcId is not None
    if counted(coord, '_ScheduleIdle') is not None:
        assert coord.Called('_CB_QueueLocationsAdded') == [(q, {A})]
        assert coord.Called('_ScheduleIdle') == [()]

    coord.SuspendIdleScans()
    assert coord._CB_QueueLocationsAdded(q, set()) is None
    assert coord._fIdleProcId is None


def test_queue_emission_from_the_main_loop_reaches_the_coordinator(coord, host):
    coord.AddPairsToPrimaryQueue([(A, 'f')])
    coord._CancelIdle()
    assert coord._fIdleProcId is None
    # The only pending idle is the queue's deferred "locations-added" emission.
    assert ostrelgtk.iteration()
    assert coord._fIdleProcId is not None


# ---- the builtins and typing modules -----------------------------------------------------

BT = local('stubs/builtins.pyi')
T1 = local('lib/typing.py')
T2 = local('lib/typing_extensions.py')


def test_basic_modules_are_queued_once_per_flush(coord, host):
    host.fFactory.SetBuiltins('builtins', [BT])
    host.fFactory.fTypingLocs = [T1, T2]

    assert coord._QueueBasicModules(0.0) is False
    assert host.fLog.names('factory') == [('factory', 'FindBuiltinMod'),
                                          ('factory', 'GetAllLocsForName'),
                                          ('factory', 'GetTypingLocations')]
    assert host.fLog.args('factory', 'GetAllLocsForName') == [('builtins', None, False)]
    expected = {(BT, '*', PRIMARY): 0, (T1, '*', PRIMARY): 0, (T2, '*', PRIMARY): 0}
    assert queued(coord) == expected
    assert coord._fAllBasicModuleQueued is True
    if counted(coord, '_ScheduleIdle') is not None:
        assert coord.Called('AddPairsToPrimaryQueue') == [
            ([(BT, '*'), (T1, '*'), (T2, '*')], True, kTypingModulePriority)]

    host.fLog.clear()
    assert coord._QueueBasicModules(0.0) is False
    assert host.fLog.find('factory') == []

    coord.FlushQueue()
    assert coord._fAllBasicModuleQueued is False
    assert coord._QueueBasicModules(1e12) is False
    assert queued(coord) == expected
    assert coord._fAllBasicModuleQueued is True


@pytest.mark.parametrize('typing_locs', [None, [], False, ()])
def test_basic_modules_without_typing_modules(coord, host, typing_locs):
    host.fFactory.SetBuiltins('builtins', [BT])
    host.fFactory.fTypingLocs = typing_locs
    assert coord._QueueBasicModules(0.0) is False
    assert queued(coord) == {(BT, '*', PRIMARY): 0}
    assert coord._fAllBasicModuleQueued is True


def test_basic_modules_wait_for_the_builtins_module(coord, host, gtk_spy):
    host.fFactory.fTypingLocs = [T1]
    assert coord._QueueBasicModules(0.0) is False
    assert host.fLog.names('factory') == [('factory', 'FindBuiltinMod')]
    assert queued(coord) == {}
    assert coord._fAllBasicModuleQueued is False
    assert coord._fIdleProcId is None

    host.fFactory.SetBuiltins('bltns', [BT])
    coord._QueueBasicModules(0.0)
    assert host.fLog.args('factory', 'GetAllLocsForName') == [('bltns', None, False)]
    assert queued(coord) == {(BT, '*', PRIMARY): 0, (T1, '*', PRIMARY): 0}


def test_basic_modules_go_through_the_helper_split(coord, host):
    host.UseHelper()
    host.fFactory.SetBuiltins('builtins', [BT])
    host.fFactory.fTypingLocs = [T1]
    coord._QueueBasicModules(0.0)
    assert [(c.args, c.kwargs) for c in host.fLog.find('helper')] == [
        (([(BT, '*'), (T1, '*')], True), {'callback': None})]
    assert queued(coord) == {}
    assert coord._fAllBasicModuleQueued is True


# ---- parseable files -------------------------------------------------------------------

def test_parseables_with_analysable_mime_types_are_queued_whole(coord, host, gtk_spy):
    host.fFileAttribMgr.fMimeTypes = {A: PY, B: 'text/plain', C: PY}
    assert coord.AddParseablesToQueue(iter([A, B, C, A, D])) is None
    assert host.fLog.args('file_attrib_mgr', 'GetMultipleProbableMimeTypes') == [
        ([(A, None), (B, None), (C, None), (D, None)],)]
    assert queued(coord) == {(A, '*', PRIMARY): kBackgroundPriority,
                             (C, '*', PRIMARY): kBackgroundPriority}
    assert whole_files_to_check(coord) == [(A, 2), (C, 2)]
    assert len(analysis_idles(coord)) == 1
    if counted(coord, '_ScheduleIdle') is not None:
        assert coord.Called('AddPairsToPrimaryQueue') == [
            ([(A, '*'), (C, '*')], True, kBackgroundPriority)]


def test_parseables_priority(coord, host):
    host.fFileAttribMgr.fMimeTypes = {A: PY, B: PY}
    coord.AddParseablesToQueue([A], priority=0)
    coord.AddParseablesToQueue([B], 1)
    assert queued(coord) == {(A, '*', PRIMARY): 0, (B, '*', PRIMARY): 1}


def test_parseables_without_analysable_files_queue_nothing(coord, host, gtk_spy):
    host.fFileAttribMgr.fMimeTypes = {B: 'text/plain'}
    coord.AddParseablesToQueue([B, D])
    coord.AddParseablesToQueue([])
    assert queued(coord) == {}
    assert coord._fIdleProcId is None
    if counted(coord, '_ScheduleIdle') is not None:
        assert coord.Called('AddPairsToPrimaryQueue') == []


def test_parseables_ask_the_current_file_attribute_manager(coord, host):
    newer = FakeFileAttribMgr(host.fLog)
    newer.fWho = 'newer_attrib_mgr'
    newer.fMimeTypes = {A: PY}
    singleton.SetSingleton('fFileAttribMgr', newer)
    coord.AddParseablesToQueue([A])
    assert host.fLog.find('file_attrib_mgr') == []
    assert len(host.fLog.find('newer_attrib_mgr')) == 1
    assert queued(coord) == {(A, '*', PRIMARY): 2}


# ---- queries -------------------------------------------------------------------------

def test_queues_empty(coord, host):
    assert coord.QueuesEmpty() is True
    assert coord.QueuesEmpty(False) is True
    coord.AddPairsToPrimaryQueue([(A, 'f')])
    assert coord.QueuesEmpty() is False
    assert coord.QueuesEmpty(False) is False
    coord.RemoveLocationsFromQueue([A])
    assert coord.QueuesEmpty() is True

    coord.AddPairsToPrimaryQueue([(W, '*')])  # waits for inspection
    assert coord.QueuesEmpty() is False
    assert coord.QueuesEmpty(False) is True
    assert coord.QueuesEmpty(include_waiting=False) is True
    coord.RemoveLocationsFromQueue([W])
    assert coord.QueuesEmpty() is True

    host.UseHelper()
    coord.AddPairsToPrimaryQueue([(A, '*')])
    assert queued(coord) == {}
    assert coord.QueuesEmpty() is False  # the helper still has work
    assert coord.QueuesEmpty(False) is False
    coord.FlushQueue()
    assert coord.QueuesEmpty() is True


def test_location_queries(coord, host):
    coord.AddPairsToPrimaryQueue([(A, 'f')])
    coord.AddPairsToSecondaryQueue([(B, 'g')])
    coord._CB_NeedsScanAdded(host.fInfoCache, [(C, 'x', OTHER)], None)
    coord.AddPairsToPrimaryQueue([(W, '*')])
    answers = {loc: (coord.LocationInPrimaryScanQueue(loc),
                     coord.LocationInSecondaryScanQueue(loc),
                     coord.LocationInScanQueues(loc))
               for loc in (A, B, C, W, D)}
    assert answers == {A: (True, False, True), B: (False, True, True),
                       C: (False, False, True), W: (False, False, False),
                       D: (False, False, False)}
    assert all(type(v) is bool for triple in answers.values() for v in triple)

    # The scan names are the analysis manager's at the time of the call.
    host.fAnaMgr.fPrimaryScanName, host.fAnaMgr.fDerivedScanName = DERIVED, PRIMARY
    assert coord.LocationInPrimaryScanQueue(B) is True
    assert coord.LocationInSecondaryScanQueue(A) is True
    assert coord.LocationInPrimaryScanQueue(A) is False


class LocSet(set):
    pass


@pytest.mark.parametrize('make', [list, tuple, lambda locs: (loc for loc in locs), set,
                                  frozenset, LocSet, dict.fromkeys],
                         ids=['list', 'tuple', 'generator', 'set', 'frozenset', 'set-subclass',
                              'dict'])
def test_remove_locations_from_queue(coord, host, make):
    coord.AddPairsToPrimaryQueue([(A, 'f'), (B, '*'), (C, 'g')])
    coord.AddPairsToSecondaryQueue([(A, 'h'), (C, '*')])
    coord.AddPairsToPrimaryQueue([(W, '*')])
    assert coord.RemoveLocationsFromQueue(make([A, W, D])) is None
    assert queued(coord) == {(B, '*', PRIMARY): 1, (C, 'g', PRIMARY): 1, (C, '*', DERIVED): 1}
    assert waiting(coord) == set()
    check_invariants(coord._fScanQueue)


def test_clear_last_scan_info(coord):
    for i, loc in enumerate((A, B, C)):
        coord._fLastScanCompleted[loc] = {('*', PRIMARY): float(i)}
    coord._fMTimeAtLastWholeFileCheck.update({A: 1.0, C: 3.0, D: 4.0})
    assert coord.ClearLastScanInfo(loc for loc in (A, C, E)) is None
    assert set(coord._fLastScanCompleted) == {B}
    assert coord._fMTimeAtLastWholeFileCheck == {D: 4.0}


# ---- flushing ---------------------------------------------------------------------------

def test_flush_queue_in_order(coord, host, gtk_spy):
    host.UseHelper()
    coord.AddPairsToPrimaryQueue([(A, '*'), (B, 'f')])  # A to the helper, B local
    coord.AddPairsToPrimaryQueue([(W, '*')])
    host.fModFileCache.emit('suspend')
    host.fFactory.SetBuiltins('builtins', [])
    coord._QueueBasicModules(0.0)
    coord._fLastScanCompleted[B] = {('f', PRIMARY): 1.0}
    coord._fMTimeAtLastWholeFileCheck[B] = 1.0
    last, mtimes = coord._fLastScanCompleted, coord._fMTimeAtLastWholeFileCheck
    sid = coord._fIdleProcId
    assert sid is not None and coord.fWaitingForRemote and coord._fAllBasicModuleQueued

    def state():
        return {'idle': coord._fIdleProcId, 'queue empty': coord._fScanQueue.Empty(),
                'scans': len(last), 'mtimes': len(mtimes),
                'basic': coord._fAllBasicModuleQueued, 'remote': coord.fWaitingForRemote,
                'helper': set(coord._fLocsQueuedInHelper)}

    record_signals(coord, host.fLog, 'end', probe=state)
    host.fCacheMgr.Probe('_ClearEOLBlindCacheAndScans',
                         lambda: host.fLog.add('probe', 'eol', state=state()))
    host.fHelper.Probe('FlushQueue', lambda *a, **k: host.fLog.add('probe', 'flush',
                                                                   state=state()))
    host.fLog.clear()

    assert coord.FlushQueue() is None

    steps = [c for c in host.fLog if c.who != 'gtk' or c.what == 'idle_remove']
    assert [(c.who, c.what) for c in steps] == [
        ('gtk', 'idle_remove'), ('signal', 'end'), ('cache_mgr', '_ClearEOLBlindCacheAndScans'),
        ('probe', 'eol'), ('helper', 'FlushQueue'), ('probe', 'flush')]
    assert steps[0].args == (sid,)
    assert steps[4].args == () and steps[4].kwargs == {'callback': None}
    before = {'idle': None, 'queue empty': False, 'scans': 1, 'mtimes': 1, 'basic': True,
              'remote': True, 'helper': {A}}
    cleared = {'idle': None, 'queue empty': True, 'scans': 0, 'mtimes': 0, 'basic': False,
               'remote': False, 'helper': {A}}
    assert [c.kwargs['state'] for c in steps[1::2]] == [before, cleared,
                                                         {**cleared, 'helper': set()}]
    assert pending_idle(sid) is None
    assert coord._fLastScanCompleted is last and coord._fMTimeAtLastWholeFileCheck is mtimes
    assert queued(coord) == {} and waiting(coord) == set()
    assert coord.QueuesEmpty() is True


def test_flush_queue_without_pending_idle_emits_no_end(coord, host, gtk_spy):
    coord.AddPairsToPrimaryQueue([(A, 'f')])
    coord._CancelIdle()
    coord._fLastScanCompleted[A] = {('f', PRIMARY): 1.0}
    record_signals(coord, host.fLog, 'end', 'scheduled')
    host.fLog.clear()

    coord.FlushQueue()
    assert host.fLog.find('signal') == []
    assert host.fLog.find('gtk', 'idle_remove') == []
    assert host.fLog.names('cache_mgr') == [('cache_mgr', '_ClearEOLBlindCacheAndScans')]
    assert host.fLog.find('helper') == []  # no helper process to flush
    assert queued(coord) == {}
    assert coord._fLastScanCompleted == {}


# ---- bad input and failing collaborators ---------------------------------------------------

@pytest.mark.parametrize('helper', [False, True], ids=['local', 'with-helper'])
@pytest.mark.parametrize('bad, exc', [((B, 'f', 'x'), ValueError), ((B,), ValueError),
                                      (None, TypeError), (5, TypeError)],
                         ids=['triple', 'single', 'none', 'int'])
def test_bad_pair_raises_and_leaves_the_queue_consistent(coord, host, helper, bad, exc):
    host.UseHelper(helper)
    pairs = [(W, '*'), (A, '*'), (D, 'h'), bad, (E, '*')]
    coord.AddPairsToPrimaryQueue([(C, 'g')])
    coord._CancelIdle()
    before = queued(coord)
    # Without a helper process the pairs go to the scan queue as they are; it
    # keeps of them what a scan queue on its own keeps of the same input.
    alone = scancoordinator._CScanQueue(FakeLocationDataCache())
    alone.SetScansToOrder({PRIMARY: 0, DERIVED: 1})
    alone.AddScanPairs([(C, 'g')], PRIMARY, kInteractivePriority, True)
    with pytest.raises(exc):
        alone.AddScanPairs(pairs, PRIMARY, kInteractivePriority, True)

    with pytest.raises(exc):
        coord.AddPairsToPrimaryQueue(pairs)

    check_invariants(coord._fScanQueue)
    if helper:
        # The split walks every pair before anything is sent anywhere.
        assert queued(coord) == before
        assert waiting(coord) == set()
    else:
        assert queued(coord) == queued(alone)
        assert waiting(coord) == waiting(alone)
        assert (W, '*', PRIMARY, kInteractivePriority) in waiting(coord)
    assert (E, '*', PRIMARY) not in queued(coord)
    assert host.fLog.find('helper') == []
    assert coord._fLocsQueuedInHelper == set()
    assert coord._fIdleProcId is None
    alone.destroy()

    coord.AddPairsToPrimaryQueue([(E, 'k')])
    assert queued(coord)[(E, 'k', PRIMARY)] == 1
    assert coord._fIdleProcId is not None


@pytest.mark.parametrize('action', [
    lambda coord: coord.AddNeedsScanSetToQueues([(A, 'f', PRIMARY), (B, 'g')]),
    lambda coord: coord.AddNeedsScanSetToQueues([(A, 'f', DERIVED), (B, 'g', PRIMARY, 'x')]),
    lambda coord: coord._CB_NeedsScanAdded(coord._fInfoCache,
                                           [(A, 'f', PRIMARY), (B, 'g')], None),
    lambda coord: coord._fInfoCache.emit('needs-scan-added', coord._fInfoCache,
                                         [(A, 'f', DERIVED), None], 0),
], ids=['set-short', 'set-long', 'report', 'report-signal'])
def test_bad_triple_raises_and_queues_nothing(coord, host, action):
    with pytest.raises((ValueError, TypeError)):
        action(coord)
    check_invariants(coord._fScanQueue)
    assert queued(coord) == {}
    assert coord._fIdleProcId is None
    coord.AddNeedsScanSetToQueues([(A, 'f', PRIMARY)])
    assert queued(coord) == {(A, '*', PRIMARY): 1}


def test_helper_proxy_error_propagates(coord, host, gtk_spy):
    host.UseHelper()
    err = Boom('helper process gone')
    host.fHelper.Fail('AddPairsToPrimaryQueue', err)
    with pytest.raises(Boom) as info:
        coord.AddPairsToPrimaryQueue([(A, '*'), (B, 'f')])
    assert info.value is err
    # The locations were recorded before the proxy failed; nothing went local.
    assert coord._fLocsQueuedInHelper == {A}
    assert queued(coord) == {}
    assert coord._fIdleProcId is None

    host.fHelper.Fail('AddPairsToPrimaryQueue', None)
    coord.AddPairsToPrimaryQueue([(C, '*'), (D, 'g')])
    assert coord._fLocsQueuedInHelper == {A, C}
    assert queued(coord) == {(D, 'g', PRIMARY): 1}


kFailingCollaborators = {
    'want-derived': ('fLocCache', 'WantDerivedInfo',
                     lambda coord: coord.AddPairsToSecondaryQueue([(A, 'f')])),
    'cache-buffer': ('fCacheMgr', 'DoesCacheBufferExist',
                     lambda coord: coord.AddNeedsScanSetToQueues([(A, 'f', PRIMARY)])),
    'can-send': ('fCacheMgr', 'DoesCacheBufferExist',
                 lambda coord: coord._CanSendToHelperProcess(A, '*')),
    'mime-types': ('fFileAttribMgr', 'GetMultipleProbableMimeTypes',
                   lambda coord: coord.AddParseablesToQueue([A])),
    'builtins': ('fFactory', 'FindBuiltinMod', lambda coord: coord._QueueBasicModules(0.0)),
    'typing': ('fFactory', 'GetTypingLocations', lambda coord: coord._QueueBasicModules(0.0)),
}


@pytest.mark.parametrize('case', list(kFailingCollaborators))
def test_collaborator_errors_propagate_unchanged(coord, host, case):
    attr, what, action = kFailingCollaborators[case]
    host.fFactory.SetBuiltins('builtins', [BT])
    host.fFileAttribMgr.fMimeTypes = {A: PY}
    double = getattr(host, attr)
    err = Boom(case)
    double.Fail(what, err)
    with pytest.raises(Boom) as info:
        action(coord)
    assert info.value is err
    assert queued(coord) == {}
    assert coord._fAllBasicModuleQueued is False
    check_invariants(coord._fScanQueue)

    double.Fail(what, None)
    action(coord)  # usable as before


def test_flush_stops_at_a_failing_cache_manager(coord, host):
    host.UseHelper()
    coord.AddPairsToPrimaryQueue([(A, '*'), (B, 'f')])
    err = Boom('cache manager')
    host.fCacheMgr.Fail('_ClearEOLBlindCacheAndScans', err)
    with pytest.raises(Boom) as info:
        coord.FlushQueue()
    assert info.value is err
    # What comes before it is done, what comes after it is not.
    assert coord._fIdleProcId is None
    assert queued(coord) == {}
    assert coord._fLocsQueuedInHelper == {A}
    assert host.fLog.find('helper', 'FlushQueue') == []

    host.fCacheMgr.Fail('_ClearEOLBlindCacheAndScans', None)
    coord.FlushQueue()
    assert coord._fLocsQueuedInHelper == set()
    assert len(host.fLog.find('helper', 'FlushQueue')) == 1


def test_flush_error_of_the_helper_propagates(coord, host):
    host.UseHelper()
    coord.AddPairsToPrimaryQueue([(A, '*')])
    err = Boom('flush')
    host.fHelper.Fail('FlushQueue', err)
    with pytest.raises(Boom) as info:
        coord.FlushQueue()
    assert info.value is err
    assert coord._fLocsQueuedInHelper == set()
    assert coord.QueuesEmpty() is True


# ---- argument handling ----------------------------------------------------------------------

def test_wrong_argument_counts_raise_type_error(coord, host):
    cls = CScanCoordinator
    calls = [
        lambda: cls.AddPairsToPrimaryQueue(coord),
        lambda: cls.AddPairsToPrimaryQueue(coord, [], True, None, 'extra'),
        lambda: cls.AddPairsToSecondaryQueue(coord),
        lambda: cls.AddNeedsScanSetToQueues(coord),
        lambda: cls.AddParseablesToQueue(coord),
        lambda: cls._CB_NeedsScanAdded(coord, host.fInfoCache, []),
        lambda: cls._CB_ActiveEditLinenoChanged(coord, FakeAnalysis(A, host.fLog)),
        lambda: cls._CB_QueueLocationsAdded(coord, coord._fScanQueue),
        lambda: cls._QueueBasicModules(coord),
        lambda: cls.QueuesEmpty(coord, True, False),
        lambda: cls._CanSendToHelperProcess(coord, A),
        lambda: cls.LocationInScanQueues(coord),
        lambda: cls.RemoveLocationsFromQueue(coord),
        lambda: cls.FlushQueue(coord, True),
        lambda: cls.ClearLastScanInfo(coord),
        lambda: cls._ScheduleIdle(coord, 1),
        lambda: cls._CancelIdle(coord, 1),
        lambda: cls.SuspendIdleScans(coord, 1),
        lambda: cls.Quitting(coord, 1),
    ]
    for i, call in enumerate(calls):
        with pytest.raises(TypeError):
            call()
        assert queued(coord) == {}, i
