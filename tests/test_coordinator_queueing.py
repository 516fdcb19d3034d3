"""CScanCoordinator: the queueing interface and the helper-process split, the
needs-scan reports, the caret leaving incomplete scopes, the builtins and typing
modules, parseable files, queries, removing and flushing, and what bad input
and failing collaborators leave behind."""
import pytest
import singleton
from coord_doubles import *
from guiutils import ostrelgtk
from queue_helpers import check_invariants

A, B, C, D, E, F = (local(f'{n}.py') for n in 'abcdef')
R = remote('r.py')  # made ready where a test needs it queued
W = remote('w.py')  # never ready: its scans wait for inspection
BT, T1, T2 = local('stubs/builtins.pyi'), local('lib/typing.py'), local('lib/typing_ext.py')
PY = 'text/x-python'


def whole_files(coord):
    return list(coord._fScanQueue._fWholeFilesToCheck.items())


@pytest.mark.parametrize('kwargs, expected', [
    ({}, 1), ({'first': True}, 1), ({'first': False}, 2), ({'priority': 0}, 0),
    ({'first': False, 'priority': 0}, 0), ({'first': True, 'priority': 2}, 2),
    ({'priority': 7}, 7)])
def test_priority_rule(coord, kwargs, expected):
    coord.AddPairsToPrimaryQueue([(A, 'f'), (B, '*')], **kwargs)
    coord.AddPairsToSecondaryQueue([(C, 'g')], **kwargs)
    assert queued(coord) == {(A, 'f', PRIMARY): expected, (B, '*', PRIMARY): expected,
                             (C, 'g', DERIVED): expected}
    # Only primary pairs register their files for the whole-file check.
    assert whole_files(coord) == [(A, expected), (B, expected)]


def test_without_helper_primary_pairs_are_queued_locally(coord, host):
    host.fDataCache.fReady.add(R)
    record_signals(coord, host.fLog, 'scheduled', probe=lambda: dict(queued(coord)))
    coord.AddPairsToPrimaryQueue(iter([(A, '*'), (B, 'g'), (R, '*')]))
    expected = {(A, '*', PRIMARY): 1, (B, 'g', PRIMARY): 1, (R, '*', PRIMARY): 1}
    assert queued(coord) == expected
    assert [c.kwargs['state'] for c in host.fLog.find('signal')] == [expected]
    assert host.fLog.find('cache_mgr') == [] and coord._fLocsQueuedInHelper == set()


def test_the_helper_takes_local_unopened_whole_files(coord, host):
    host.fDataCache.fReady.add(R)
    host.UseHelper()
    host.fCacheMgr.OpenBuffer(B)
    seen = []
    host.fHelper.Probe('AddPairsToPrimaryQueue', lambda *a, **k: seen.append(
        (set(coord._fLocsQueuedInHelper), dict(queued(coord)))))
    coord.AddPairsToPrimaryQueue([(A, '*'), (C, 'Cls.m'), (B, '*'), (R, '*'), (D, '*')], False)
    assert host.fLog.args('cache_mgr', 'DoesCacheBufferExist') == [(A, True), (B, True),
                                                                   (D, True)]
    assert [(c.args, c.kwargs) for c in host.fLog.find('helper')] == [
        (([(A, '*'), (D, '*')], False), {'callback': None})]
    # Recorded before the proxy is called; the local queue is filled afterwards.
    assert seen == [({A, D}, {})]
    assert queued(coord) == {(C, 'Cls.m', PRIMARY): 2, (B, '*', PRIMARY): 2,
                             (R, '*', PRIMARY): 2}
    assert len(pending_callbacks(coord)) == 1
    coord._CancelIdle()
    coord.AddPairsToPrimaryQueue([(E, '*')], priority=0)
    assert coord._fIdleProcId is None and whole_files(coord) == [(C, 2), (B, 2), (R, 2)]


def test_secondary_pairs_are_filtered_by_want_derived_info(coord, host):
    host.UseHelper()  # never used for secondary scans
    host.fLocCache.fAnswers = {B: 0, C: 'yes', D: ''}
    coord.AddPairsToSecondaryQueue(iter([(A, '*'), (B, '*'), (C, 'f'), (D, 'g')]))
    assert host.fLog.args('loc_cache', 'WantDerivedInfo') == [(A,), (B,), (C,), (D,)]
    assert queued(coord) == {(A, '*', DERIVED): 1, (C, 'f', DERIVED): 1}
    assert host.fLog.find('helper') == []
    coord._CancelIdle()
    coord.AddPairsToSecondaryQueue([(B, 'x')])
    assert coord._fIdleProcId is None


def test_needs_scan_set_queues_secondary_then_primary(coord, host):
    host.fCacheMgr.OpenBuffer(B)
    coord.AddNeedsScanSetToQueues([(A, 'f', PRIMARY), (C, 'h', DERIVED), (B, 'g', PRIMARY),
                                   (E, 'x', 'other'), (F, 'y', DERIVED)])
    # A file without a buffer is scanned whole; an open one by the reported scope.
    assert queued(coord) == {(A, '*', PRIMARY): 1, (B, 'g', PRIMARY): 1,
                             (C, 'h', DERIVED): 1, (F, 'y', DERIVED): 1}
    assert list(coord._fScanQueue._fPerLocationInfo) == [C, F, A, B]
    coord._CancelIdle()
    coord.AddNeedsScanSetToQueues({(A, 'f', 'other')})
    assert coord._fIdleProcId is None
    host.UseHelper()
    coord.AddNeedsScanSetToQueues({(D, 'f', PRIMARY)})
    assert host.fLog.args('helper', 'AddPairsToPrimaryQueue') == [([(D, '*')], True)]


@pytest.mark.parametrize('priority, expected', [(None, 1), (0, 0), (2, 2)])
def test_needs_scan_report_groups_by_scan_name_in_first_seen_order(coord, host, priority,
                                                                   expected):
    host.UseHelper()  # the report goes straight into the scan queue
    host.fLocCache.fAnswers = {D: False}
    triples = [(A, 'f', DERIVED), (B, 'g', PRIMARY), (C, 'h', DERIVED), (E, 'x', 'other'),
               (F, '*', PRIMARY), (D, 'k', DERIVED)]
    host.fInfoCache.emit('needs-scan-added', host.fInfoCache, iter(triples), priority)
    assert queued(coord) == {t: expected for t in triples[:-1]}
    assert list(coord._fScanQueue._fPerLocationInfo) == [A, C, B, F, E]
    assert host.fLog.args('loc_cache', 'WantDerivedInfo') == [(A,), (C,), (D,)]
    assert host.fLog.find('helper') == [] and whole_files(coord) == []
    coord._CancelIdle()
    coord._CB_NeedsScanAdded(host.fInfoCache, [(D, 'f', DERIVED)], None)
    assert coord._fIdleProcId is not None  # scheduled even when nothing was queued


def test_the_caret_leaving_incomplete_scopes_requeues_them(coord, host):
    coord._fIncompleteScansByLoc[A] = ['g', 'f', 'h']
    coord._fLastScanCompleted[A] = {('f', PRIMARY): 1.0}
    coord._fLastScanCompleted[B] = {('*', PRIMARY): 2.0}
    Analysis(A, host.fLog, {10: 'f'}).SetActiveEditLineno(10)
    assert host.fLog.args('analysis', 'FindScopeContainingLine') == [(10,)]
    assert queued(coord) == {(A, 'g', PRIMARY): 1, (A, 'h', PRIMARY): 1}
    assert set(coord._fLastScanCompleted) == {B}
    assert len(pending_callbacks(coord)) == 1
    # Outside the file: every incomplete scope, without asking the analysis.
    coord._fIncompleteScansByLoc[C] = ['g', 'f']
    ana = Analysis(C, host.fLog, {10: 'f'})
    ana.emit('active-edit-lineno-changed', ana, -1)
    assert len(host.fLog.find('analysis')) == 1
    assert {k for k in queued(coord) if k[0] == C} == {(C, 'g', PRIMARY), (C, 'f', PRIMARY)}


def test_the_caret_in_the_only_incomplete_scope_changes_nothing(coord, host):
    coord._fIncompleteScansByLoc[A] = {'f'}
    coord._fLastScanCompleted[A] = {('f', PRIMARY): 1.0}
    Analysis(A, host.fLog, {10: 'f'}).SetActiveEditLineno(10)
    coord._CB_ActiveEditLinenoChanged(Analysis(B, host.fLog, {5: 'f'}), 5)
    assert B not in coord._fIncompleteScansByLoc  # looked up without adding an entry
    assert queued(coord) == {} and coord._fIdleProcId is None
    assert set(coord._fLastScanCompleted) == {A}


def test_locations_added_by_the_queue_schedule_the_idle(coord, host):
    coord.AddPairsToPrimaryQueue([(A, 'f')])
    coord._CancelIdle()
    # The only pending idle is the queue's deferred "locations-added" emission.
    assert ostrelgtk.iteration()
    assert coord._fIdleProcId is not None
    coord.SuspendIdleScans()
    coord._fScanQueue.emit('locations-added', coord._fScanQueue, {A})
    assert coord._fIdleProcId is None


def test_basic_modules_are_queued_once_per_flush(coord, host):
    host.fFactory.SetBuiltins('bltns', [BT])
    host.fFactory.fTypingLocs = [T1, T2]
    assert coord._QueueBasicModules(0.0) is False
    assert [c.what for c in host.fLog] == ['FindBuiltinMod', 'GetAllLocsForName',
                                           'GetTypingLocations']
    assert host.fLog.args('factory', 'GetAllLocsForName') == [('bltns', None, False)]
    expected = {(BT, '*', PRIMARY): 0, (T1, '*', PRIMARY): 0, (T2, '*', PRIMARY): 0}
    assert queued(coord) == expected and coord._fAllBasicModuleQueued is True
    host.fLog.clear()
    assert coord._QueueBasicModules(0.0) is False
    assert host.fLog == []
    coord.FlushQueue()
    assert coord._fAllBasicModuleQueued is False
    host.UseHelper()
    host.fFactory.fTypingLocs = None
    coord._QueueBasicModules(1e12)
    assert host.fLog.args('helper', 'AddPairsToPrimaryQueue') == [([(BT, '*')], True)]
    assert coord._fAllBasicModuleQueued is True


def test_basic_modules_wait_for_the_builtins_module(coord, host):
    host.fFactory.fTypingLocs = [T1]
    assert coord._QueueBasicModules(0.0) is False
    assert [c.what for c in host.fLog] == ['FindBuiltinMod']
    assert queued(coord) == {} and coord._fAllBasicModuleQueued is False
    assert coord._fIdleProcId is None


def test_parseables_with_analysable_mime_types_are_queued_whole(coord, host):
    host.fFileAttribMgr.fMimeTypes = {A: PY, B: 'text/plain', C: PY}
    coord.AddParseablesToQueue(iter([A, B, C, A, D]))
    coord.AddParseablesToQueue([C], 0)
    assert host.fLog.args('file_attrib_mgr', 'GetMultipleProbableMimeTypes')[0] == (
        [(A, None), (B, None), (C, None), (D, None)],)
    assert queued(coord) == {(A, '*', PRIMARY): 2, (C, '*', PRIMARY): 0}
    coord._CancelIdle()
    coord.AddParseablesToQueue([B, D])
    assert coord._fIdleProcId is None
    newer = FileAttribMgr(host.fLog)
    newer.fWho, newer.fMimeTypes = 'newer', {E: PY}
    singleton.SetSingleton('fFileAttribMgr', newer)
    coord.AddParseablesToQueue([E])
    assert queued(coord)[(E, '*', PRIMARY)] == 2 and len(host.fLog.find('newer')) == 1


def test_queries(coord, host):
    assert coord.QueuesEmpty() is True
    coord.AddPairsToPrimaryQueue([(A, 'f')])
    coord.AddPairsToSecondaryQueue([(B, 'g')])
    coord._CB_NeedsScanAdded(host.fInfoCache, [(C, 'x', 'other')], None)
    coord.AddPairsToPrimaryQueue([(W, '*')])
    assert {loc: (coord.LocationInPrimaryScanQueue(loc), coord.LocationInSecondaryScanQueue(loc),
                  coord.LocationInScanQueues(loc)) for loc in (A, B, C, W)} == {
        A: (True, False, True), B: (False, True, True), C: (False, False, True),
        W: (False, False, False)}
    # The scan names are the analysis manager's at the time of the call.
    host.fAnaMgr.fPrimaryScanName = DERIVED
    assert coord.LocationInPrimaryScanQueue(B) is True
    coord.RemoveLocationsFromQueue([A, B, C])
    assert (coord.QueuesEmpty(), coord.QueuesEmpty(include_waiting=False)) == (False, True)
    coord.RemoveLocationsFromQueue([W])
    host.UseHelper()
    coord.AddPairsToPrimaryQueue([(A, '*')])
    assert coord.QueuesEmpty(False) is False  # the helper still has work


class LocSet(set):
    pass


@pytest.mark.parametrize('make', [list, lambda locs: (loc for loc in locs), frozenset, LocSet,
                                  dict.fromkeys])
def test_remove_locations_from_queue(coord, make):
    coord.AddPairsToPrimaryQueue([(A, 'f'), (B, '*'), (W, '*')])
    coord.AddPairsToSecondaryQueue([(A, 'h'), (C, '*')])
    assert coord.RemoveLocationsFromQueue(make([A, W, D])) is None
    assert queued(coord) == {(B, '*', PRIMARY): 1, (C, '*', DERIVED): 1}
    assert waiting(coord) == set()
    check_invariants(coord._fScanQueue)


def test_flush_queue_in_order(coord, host):
    host.UseHelper()
    coord.AddPairsToPrimaryQueue([(A, '*'), (B, 'f'), (W, '*')])
    host.fModFileCache.emit('suspend')
    host.fFactory.SetBuiltins('builtins', [])
    coord._QueueBasicModules(0.0)
    coord._fLastScanCompleted[B] = {('f', PRIMARY): 1.0}
    coord._fMTimeAtLastWholeFileCheck[B] = 1.0

    def state(*args, **kwargs):
        host.fLog.add('state', (
            coord._fIdleProcId, coord._fScanQueue.Empty(), len(coord._fLastScanCompleted),
            len(coord._fMTimeAtLastWholeFileCheck), coord._fAllBasicModuleQueued,
            coord.fWaitingForRemote, set(coord._fLocsQueuedInHelper)))

    coord.connect('end', state)
    host.fCacheMgr.Probe('_ClearEOLBlindCacheAndScans', state)
    host.fHelper.Probe('FlushQueue', state)
    host.fLog.clear()
    assert coord.FlushQueue() is None
    cleared = (None, True, 0, 0, False, False, {A})
    assert [c.what for c in host.fLog] == [
        (None, False, 1, 1, True, True, {A}), '_ClearEOLBlindCacheAndScans', cleared,
        'FlushQueue', (*cleared[:-1], set())]
    assert host.fLog[-2].kwargs == {'callback': None} and coord.QueuesEmpty()
    host.UseHelper(False)
    host.fLog.clear()
    coord.FlushQueue()  # no idle: no "end"; no helper: nothing to flush
    assert [c.who for c in host.fLog] == ['cache_mgr', 'state']


@pytest.mark.parametrize('helper', [False, True])
@pytest.mark.parametrize('bad, exc', [((B, 'f', 'x'), ValueError), (None, TypeError)])
def test_a_bad_pair_raises_and_leaves_the_queue_consistent(coord, host, helper, bad, exc):
    host.UseHelper(helper)
    with pytest.raises(exc):
        coord.AddPairsToPrimaryQueue([(W, '*'), (A, '*'), (D, 'h'), bad, (E, '*')])
    check_invariants(coord._fScanQueue)
    # The split walks every pair before anything is sent anywhere; without it the
    # scan queue keeps what it read before the bad pair.
    assert queued(coord) == ({} if helper else {(A, '*', PRIMARY): 1, (D, 'h', PRIMARY): 1})
    assert bool(waiting(coord)) is not helper
    assert host.fLog.find('helper') == [] and coord._fLocsQueuedInHelper == set()
    assert coord._fIdleProcId is None


@pytest.mark.parametrize('triples', [[(A, 'f', PRIMARY), (B, 'g')],
                                     [(A, 'f', DERIVED), (B, 'g', PRIMARY, 'x')]])
def test_a_bad_triple_raises_and_queues_nothing(coord, host, triples):
    for call in (coord.AddNeedsScanSetToQueues,
                 lambda t: coord._CB_NeedsScanAdded(host.fInfoCache, t, None)):
        with pytest.raises((ValueError, TypeError)):
            call(triples)
    assert queued(coord) == {} and coord._fIdleProcId is None


def test_helper_errors_propagate(coord, host):
    host.UseHelper()
    host.fHelper.Fail('AddPairsToPrimaryQueue', Boom('helper process gone'))
    with pytest.raises(Boom):
        coord.AddPairsToPrimaryQueue([(A, '*'), (B, 'f')])
    # The locations were recorded before the proxy failed; nothing went local.
    assert coord._fLocsQueuedInHelper == {A} and queued(coord) == {}
    host.fCacheMgr.Fail('_ClearEOLBlindCacheAndScans', Boom('cache manager'))
    with pytest.raises(Boom):
        coord.FlushQueue()
    assert coord._fLocsQueuedInHelper == {A} and host.fLog.find('helper', 'FlushQueue') == []
    host.fCacheMgr.Fail('_ClearEOLBlindCacheAndScans', None)
    host.fHelper.Fail('FlushQueue', Boom('flush'))
    with pytest.raises(Boom):
        coord.FlushQueue()
    assert coord._fLocsQueuedInHelper == set()


@pytest.mark.parametrize('attr, what, action', [
    ('fLocCache', 'WantDerivedInfo', lambda c: c.AddPairsToSecondaryQueue([(A, 'f')])),
    ('fCacheMgr', 'DoesCacheBufferExist', lambda c: c.AddNeedsScanSetToQueues([(A, 'f', PRIMARY)])),
    ('fFileAttribMgr', 'GetMultipleProbableMimeTypes', lambda c: c.AddParseablesToQueue([A])),
    ('fFactory', 'FindBuiltinMod', lambda c: c._QueueBasicModules(0.0)),
    ('fFactory', 'GetTypingLocations', lambda c: c._QueueBasicModules(0.0)),
])
def test_collaborator_errors_propagate_unchanged(coord, host, attr, what, action):
    host.fFactory.SetBuiltins('builtins', [BT])
    host.fFileAttribMgr.fMimeTypes = {A: PY}
    err = Boom(what)
    getattr(host, attr).Fail(what, err)
    with pytest.raises(Boom) as info:
        action(coord)
    assert info.value is err
    assert queued(coord) == {} and coord._fAllBasicModuleQueued is False
    getattr(host, attr).Fail(what, None)
    action(coord)
    assert queued(coord) != {}
