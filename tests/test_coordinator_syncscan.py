"""CScanCoordinator: scanning on the caller's stack.

Covers `TryToScanDictNow` (which triples it scans, queues or leaves alone, the
deadline, the two triple sets on every way out, and real re-entry from inside
a scan), `TryToScanNow` (its two shared answers, which scanners run for which
scan names, what is removed from or left in the queue, scanners that raise,
and an unfinished scan that the idle loop completes later), and the two
builders of instance scopes: by inference within a deadline, and from what the
information cache already holds.

Tests that take `synccoord` run on the class and on SyncCountingCoordinator;
on the latter they also check the calls that reached the overrides.
"""
import time

import pytest
import singleton
from coord_doubles import DERIVED, PRIMARY, Boom, analysis_idles, local, queued
from guiutils import ostrelgtk
from scan_doubles import (
    PRIMARY_SCOPE,
    SECONDARY_SCOPE,
    active,
    kFinishedScanning,
    kReadyToScan,
    kScanAbandoned,
    kTimedOut,
    kWaitingForData,
)
from syncscan_doubles import *
from syncscan_doubles import class_def, is_sync_counting, method_def, scope_info

from pysource import scopeinfo, scopescanner, symbolinfo

A = local('pkg/a.py')
B = local('pkg/b.py')

T1 = (A, 'f', PRIMARY)
T2 = (A, 'g', PRIMARY)
T3 = (B, 'h', PRIMARY)
D1 = (A, 'f', DERIVED)
D2 = (B, 'k', DERIVED)
OUTER_PENDING = (B, 'z', PRIMARY)   # promised by a call further up
OUTER_ACTIVE = (B, 'y', PRIMARY)    # being scanned further up

SINGLETON_PRIMARY = 'primary-of-the-singleton-manager'


def end_in(seconds=5.0):
    return time.time() + seconds


def sets(coord):
    return set(coord._fActiveScanNowTriples), set(coord._fPendingScanNowTriples)


def scope_scanners(host, kind=PRIMARY_SCOPE):
    return [s.fKey for s in host.fScanners.Made(kind)]


def snapshot_step(coord, seen, state=kFinishedScanning):
    """A scanner script entry that notes the two triple sets while it scans."""
    def step(scanner, end_time):
        seen.append((scanner.fKey, *sets(coord)))
        return state
    return step


class Clock:
    """Stands in for `time.time`; scanner steps move it on."""

    def __init__(self, now):
        self.fNow = now

    def __call__(self):
        return self.fNow

    def MoveTo(self, now, state=kFinishedScanning):
        def step(scanner, end_time):
            self.fNow = now
            return state
        return step


@pytest.fixture
def clock(monkeypatch):
    c = Clock(1000.0)
    monkeypatch.setattr(time, 'time', c)
    return c


@pytest.fixture
def buffers(synchost):
    """A and B are open in the editor, so queued primary triples keep their scope."""
    synchost.fCacheMgr.OpenBuffer(A)
    synchost.fCacheMgr.OpenBuffer(B)


@pytest.fixture
def other_singleton_manager():
    """The application-wide analysis manager names another primary scan than the
    coordinator's own, so a test can tell which one was read."""
    singleton.SetSingleton('fAnalysisMgr', type('Mgr', (), {
        'fPrimaryScanName': SINGLETON_PRIMARY})())


@pytest.fixture
def inst_spy(monkeypatch):
    """Records the calls of scopescanner.CreateClassInstInfo, and what each returned."""
    calls = []
    real = scopescanner.CreateClassInstInfo

    def spy(class_info, method_infos, scan_name):
        result = real(class_info, method_infos, scan_name)
        calls.append(((class_info, list(method_infos), scan_name), result))
        return result
    monkeypatch.setattr(scopescanner, 'CreateClassInstInfo', spy)
    return calls


# ---- TryToScanDictNow: what goes where --------------------------------------------------

@pytest.mark.parametrize('empty', [set(), frozenset(), []], ids=['set', 'frozenset', 'list'])
def test_an_empty_set_touches_nothing(synccoord, synchost, empty):
    synccoord._fPendingScanNowTriples.add(OUTER_PENDING)
    synchost.fLog.clear()
    if is_sync_counting(synccoord):
        synccoord.fCalls.clear()
    assert synccoord.TryToScanDictNow(A, 'f', empty, end_in()) is False
    assert synchost.fLog == []
    assert queued(synccoord) == {}
    assert sets(synccoord) == (set(), {OUTER_PENDING})
    if is_sync_counting(synccoord):
        assert synccoord.fCalls == []


def test_derived_triples_are_queued_one_call_each(synccoord, synchost):
    assert synccoord.TryToScanDictNow(A, 'f', [D1, D2], end_in()) is False
    assert queued(synccoord) == {D1: 1, D2: 1}
    assert synchost.fScanners.Made() == []
    assert sets(synccoord) == (set(), set())
    if is_sync_counting(synccoord):
        assert synccoord.Called('AddPairsToSecondaryQueue') == [
            ([(A, 'f')], True, None), ([(B, 'k')], True, None)]
        assert synccoord.Called('TryToScanNow') == []
        assert synccoord.Called('AddNeedsScanSetToQueues') == []


def test_derived_triples_active_or_pending_further_up_are_left_alone(synccoord, synchost):
    synccoord._fActiveScanNowTriples.add(D1)
    synccoord._fPendingScanNowTriples.add(D2)
    assert synccoord.TryToScanDictNow(A, 'f', [D1, D2], end_in()) is False
    assert queued(synccoord) == {}
    assert sets(synccoord) == ({D1}, {D2})
    if is_sync_counting(synccoord):
        assert synccoord.Called('AddPairsToSecondaryQueue') == []


def test_primary_triples_are_scanned_in_order(synccoord, synchost):
    seen = []
    for triple in (T1, T2, T3):
        synchost.fScanners.Script(PRIMARY_SCOPE, triple[:2], [snapshot_step(synccoord, seen)])
    synccoord.AddPairsToPrimaryQueue([(A, 'g')], False)
    end = end_in()

    assert synccoord.TryToScanDictNow(A, 'f', [T1, D1, T2, T3], end) is True

    assert scope_scanners(synchost) == [(A, 'f'), (A, 'g'), (B, 'h')]
    # Each triple is active while it is scanned; the ones not reached yet stay promised.
    assert seen == [((A, 'f'), {T1}, {T1, T2, T3}),
                    ((A, 'g'), {T2}, {T2, T3}),
                    ((B, 'h'), {T3}, {T3})]
    assert all(s.fScans[0].end_time == end for s in synchost.fScanners.Made())
    # Only the primary scans run; the queued primary pair is gone with its scan, the
    # derived triple went to the secondary queue.
    assert synchost.fScanners.Made(SECONDARY_SCOPE) == []
    assert queued(synccoord) == {D1: 1}
    assert sets(synccoord) == (set(), set())
    if is_sync_counting(synccoord):
        assert synccoord.Called('TryToScanNow') == [
            (A, 'f', [PRIMARY], end, True), (A, 'g', [PRIMARY], end, True),
            (B, 'h', [PRIMARY], end, True)]
        assert synccoord.Called('AddPairsToSecondaryQueue') == [([(A, 'f')], True, None)]
        assert synccoord.Called('AddNeedsScanSetToQueues') == []


def test_a_triple_active_further_up_is_neither_scanned_nor_queued(synccoord, synchost,
                                                                 buffers):
    synccoord._fActiveScanNowTriples.add(OUTER_ACTIVE)
    assert synccoord.TryToScanDictNow(B, 'y', [OUTER_ACTIVE, T1], end_in()) is True
    assert scope_scanners(synchost) == [(A, 'f')]
    assert queued(synccoord) == {}
    assert sets(synccoord) == ({OUTER_ACTIVE}, set())
    if is_sync_counting(synccoord):
        assert synccoord.Called('AddNeedsScanSetToQueues') == []


# ---- TryToScanDictNow: the deadline ---------------------------------------------------------

def test_running_out_of_time_after_the_first_of_three(synccoord, synchost, clock, buffers):
    end = 1000.5
    synchost.fScanners.Script(PRIMARY_SCOPE, (A, 'f'), [clock.MoveTo(1000.6)])

    assert synccoord.TryToScanDictNow(A, 'f', [T1, T2, T3], end) is False

    assert scope_scanners(synchost) == [(A, 'f')]
    # All three are queued, the scanned one too: its scan took up the whole budget.
    assert queued(synccoord) == {T1: 1, T2: 1, T3: 1}
    assert sets(synccoord) == (set(), set())
    if is_sync_counting(synccoord):
        assert synccoord.Called('AddNeedsScanSetToQueues') == [({T1, T2, T3},)]


def test_reaching_the_deadline_exactly_is_not_running_out(synccoord, synchost, clock):
    end = 1000.5
    synchost.fScanners.Script(PRIMARY_SCOPE, (A, 'f'), [clock.MoveTo(end)])
    assert synccoord.TryToScanDictNow(A, 'f', [T1, T2, T3], end) is True
    assert scope_scanners(synchost) == [(A, 'f'), (A, 'g'), (B, 'h')]
    assert queued(synccoord) == {}


@pytest.mark.parametrize('way_out', ['finished', 'out of time', 'raises'])
def test_the_triple_sets_are_restored_on_every_way_out(synccoord, synchost, clock, buffers,
                                                       way_out):
    end = 1000.5
    synccoord._fActiveScanNowTriples.add(OUTER_ACTIVE)
    synccoord._fPendingScanNowTriples.add(OUTER_PENDING)
    if way_out == 'out of time':
        synchost.fScanners.Script(PRIMARY_SCOPE, (A, 'f'), [clock.MoveTo(end + 1)])
    elif way_out == 'raises':
        synchost.fScanners.Script(PRIMARY_SCOPE, (A, 'g'), [Boom('scan failed')])
    needs = [T1, OUTER_ACTIVE, T2, T3]

    if way_out == 'raises':
        with pytest.raises(Boom):
            synccoord.TryToScanDictNow(A, 'f', needs, end)
    else:
        assert synccoord.TryToScanDictNow(A, 'f', needs, end) is (way_out == 'finished')

    assert sets(synccoord) == ({OUTER_ACTIVE}, {OUTER_PENDING})
    assert all(s.fDestroyCount == 1 for s in synchost.fScanners.Made())
    # What was not scanned is queued; the triple active further up never is.
    expected = {'finished': {}, 'out of time': {T1: 1, T2: 1, T3: 1},
                'raises': {T2: 1, T3: 1}}[way_out]
    assert queued(synccoord) == expected
    assert (B, 'y') not in scope_scanners(synchost)
    if is_sync_counting(synccoord):
        assert synccoord.Called('AddNeedsScanSetToQueues') == (
            [(set(expected),)] if expected else [])


# ---- TryToScanDictNow: re-entry ---------------------------------------------------------------

def test_reentry_for_the_triple_being_scanned(synccoord, synchost):
    nested = []

    def step(scanner, end_time):
        nested.append(synccoord.TryToScanDictNow(A, 'f', [T1], end_time))
        nested.append(sets(synccoord))
        return kFinishedScanning
    synchost.fScanners.Script(PRIMARY_SCOPE, (A, 'f'), [step])

    assert synccoord.TryToScanDictNow(A, 'f', [T1], end_in()) is True
    assert nested == [False, ({T1}, {T1})]
    assert scope_scanners(synchost) == [(A, 'f')]
    assert queued(synccoord) == {}
    assert sets(synccoord) == (set(), set())
    if is_sync_counting(synccoord):
        assert len(synccoord.Called('TryToScanNow')) == 1
        assert synccoord.Called('AddNeedsScanSetToQueues') == []


def test_reentry_serves_a_promised_triple_once(synccoord, synchost, buffers):
    nested = []

    def step(scanner, end_time):
        nested.append(synccoord.TryToScanDictNow(A, 'g', [T1, T2, T3, D1], end_time))
        nested.append(sets(synccoord))
        return kFinishedScanning
    synchost.fScanners.Script(PRIMARY_SCOPE, (A, 'f'), [step])

    assert synccoord.TryToScanDictNow(A, 'f', [T1, T2], end_in()) is True

    # The nested call skipped the active triple and scanned the promised one and its
    # own new one; the outer call then did not scan the promised one again.
    assert nested == [True, ({T1}, {T1})]
    assert scope_scanners(synchost) == [(A, 'f'), (A, 'g'), (B, 'h')]
    assert sets(synccoord) == (set(), set())
    # Nothing is lost: the derived triple is queued, and the triple the outer call had
    # promised but did not scan itself is queued by it again.
    assert queued(synccoord) == {D1: 1, T2: 1}
    if is_sync_counting(synccoord):
        assert [c[:2] for c in synccoord.Called('TryToScanNow')] == [
            (A, 'f'), (A, 'g'), (B, 'h')]
        assert synccoord.Called('sets at TryToScanNow') == [
            ({T1}, {T1, T2}), ({T1, T2}, {T1, T2, T3}), ({T1, T3}, {T1, T3})]
        assert synccoord.Called('AddNeedsScanSetToQueues') == [({T2},)]


# ---- TryToScanNow -----------------------------------------------------------------------------

def test_a_missing_file_answers_the_shared_false_tuple(synccoord, synchost):
    synccoord.AddPairsToPrimaryQueue([(A, 'f')], False)
    synccoord.AddPairsToSecondaryQueue([(A, 'f')], False)
    synchost.fScanners.Script(PRIMARY_SCOPE, (A, 'f'), file_doesnt_exist=True)
    synchost.fScanners.Script(PRIMARY_SCOPE, (B, 'h'), file_doesnt_exist=True)

    first = synccoord.TryToScanNow(A, 'f', None, end_in())
    assert first == (False, None, None)
    assert synccoord.TryToScanNow(B, 'h', [PRIMARY], end_in()) is first
    assert synccoord.TryToScanNow(A, 'f', None, end_in()) is first

    assert queued(synccoord) == {D1: 2}
    scanners = synchost.fScanners.Made()
    assert [s.kKind for s in scanners] == [PRIMARY_SCOPE] * 3
    assert all(s.fDestroyCount == 1 and s.fSaves == [] for s in scanners)
    if is_sync_counting(synccoord):
        assert synccoord.Called('__DoSecondarySingleScopeScan') == []


def test_waiting_for_data_answers_the_shared_true_tuple(synccoord, synchost):
    synccoord.AddPairsToSecondaryQueue([(A, 'f')], False)
    synchost.fScanners.Script(PRIMARY_SCOPE, (A, 'f'), [kWaitingForData])
    synchost.fScanners.Script(PRIMARY_SCOPE, (B, 'h'), [kWaitingForData])

    first = synccoord.TryToScanNow(A, 'f', None, end_in())
    assert first == (True, None, None)
    assert synccoord.TryToScanNow(B, 'h', None, end_in()) is first

    # Re-queued in front (interactive priority), nothing saved, no secondary scan.
    assert queued(synccoord) == {T1: 1, T3: 1, D1: 2}
    scanners = synchost.fScanners.Made()
    assert [s.kKind for s in scanners] == [PRIMARY_SCOPE] * 2
    assert all(s.fDestroyCount == 1 and s.fSaves == [] for s in scanners)
    if is_sync_counting(synccoord):
        assert synccoord.Called('AddPairsToPrimaryQueue') == [
            ([(A, 'f')], True, None), ([(B, 'h')], True, None)]
        assert synccoord.Called('__DoSecondarySingleScopeScan') == []


@pytest.mark.parametrize('state', [kFinishedScanning, kScanAbandoned],
                         ids=['finished', 'abandoned'])
def test_a_completed_scan_is_saved_and_followed_by_the_secondary_scan(synccoord, synchost,
                                                                      state):
    info = synchost.fInfoCache.Put(scope_info(B, 'h'))
    synccoord.AddPairsToPrimaryQueue([(B, 'h')], False)
    synccoord.AddPairsToSecondaryQueue([(B, 'h')], False)
    synchost.fScanners.Script(PRIMARY_SCOPE, (B, 'h'), [state])
    end = end_in()
    synchost.fLog.clear()

    assert synccoord.TryToScanNow(B, 'h', None, end) is None

    primary = synchost.fScanners.One(PRIMARY_SCOPE)
    secondary = synchost.fScanners.One(SECONDARY_SCOPE)
    assert primary.fArgs == (B, 'h')
    assert primary.fKwargs['incomplete_scope_set'] is synccoord._fIncompleteScansByLoc[B]
    assert primary.fKwargs['log'] is synccoord.fLog
    assert primary.fSaves == [((), {})]
    assert secondary.fArgs == (info, synccoord.fLog, None, synchost.fAnaMgr)
    assert [c.end_time for c in primary.fScans + secondary.fScans] == [end, end]
    assert [(c.what, c.args[0]) for c in synchost.fLog.find('scanner')] == [
        ('create', PRIMARY_SCOPE), ('Scan', PRIMARY_SCOPE), ('SaveToInfoCache', PRIMARY_SCOPE),
        ('destroy', PRIMARY_SCOPE), ('create', SECONDARY_SCOPE), ('Scan', SECONDARY_SCOPE),
        ('destroy', SECONDARY_SCOPE)]
    assert queued(synccoord) == {}
    if is_sync_counting(synccoord):
        assert synccoord.Called('__DoSecondarySingleScopeScan') == [(B, 'h', end)]


def test_the_primary_scanner_starts_the_incomplete_set_of_a_new_location(synccoord,
                                                                        synchost):
    assert B not in synccoord._fIncompleteScansByLoc
    synccoord.TryToScanNow(B, 'h', [PRIMARY], end_in())
    scanner = synchost.fScanners.One(PRIMARY_SCOPE)
    assert synccoord._fIncompleteScansByLoc[B] == set()
    assert scanner.fKwargs['incomplete_scope_set'] is synccoord._fIncompleteScansByLoc[B]


@pytest.mark.parametrize('names, kinds', [
    ([DERIVED], [SECONDARY_SCOPE]),
    ([PRIMARY], [PRIMARY_SCOPE]),
    ([DERIVED, PRIMARY], [PRIMARY_SCOPE, SECONDARY_SCOPE]),
    ([], []),
    (['another-scan'], []),
], ids=['derived', 'primary', 'both', 'none', 'other'])
def test_the_scan_name_list_chooses_the_scans(synccoord, synchost, names, kinds):
    synchost.fInfoCache.Put(scope_info(A, 'f'))
    synccoord.AddPairsToPrimaryQueue([(A, 'f')], False)
    synccoord.AddPairsToSecondaryQueue([(A, 'f')], False)
    assert synccoord.TryToScanNow(A, 'f', names, end_in()) is None
    assert [s.kKind for s in synchost.fScanners.Made()] == kinds
    remaining = {T1: 2, D1: 2}
    if PRIMARY in names:
        del remaining[T1]
    if DERIVED in names:
        del remaining[D1]
    assert queued(synccoord) == remaining


def test_a_secondary_scan_still_running_keeps_its_queue_entry(synccoord, synchost):
    synchost.fInfoCache.Put(scope_info(A, 'f'))
    synccoord.AddPairsToSecondaryQueue([(A, 'f')], False)
    synchost.fScanners.Script(SECONDARY_SCOPE, (A, 'f'), [kTimedOut, kFinishedScanning])

    assert synccoord.TryToScanNow(A, 'f', [DERIVED], end_in()) is None
    scanner = synchost.fScanners.One(SECONDARY_SCOPE)
    assert queued(synccoord) == {D1: 2}
    assert active(synccoord, SECONDARY_SCOPE) == {(A, 'f'): scanner}
    assert scanner.fDestroyCount == 0

    # The next request continues the same scanner, which now finishes.
    assert synccoord.TryToScanNow(A, 'f', [DERIVED], end_in()) is None
    assert synchost.fScanners.Made() == [scanner]
    assert len(scanner.fScans) == 2 and scanner.fDestroyCount == 1
    assert active(synccoord, SECONDARY_SCOPE) == {}
    assert queued(synccoord) == {}


def test_an_unwanted_secondary_scan_is_dropped_from_the_queue(synccoord, synchost):
    synchost.fInfoCache.Put(scope_info(A, 'f'))
    synccoord.AddPairsToSecondaryQueue([(A, 'f')], False)
    synchost.fLocCache.fAnswers[A] = False
    assert synccoord.TryToScanNow(A, 'f', [DERIVED], end_in()) is None
    assert synchost.fScanners.Made() == []
    assert queued(synccoord) == {}


def test_a_raising_scan_still_destroys_its_scanner(synccoord, synchost):
    synccoord.AddPairsToPrimaryQueue([(A, 'f')], False)
    synccoord.AddPairsToSecondaryQueue([(A, 'f')], False)
    synchost.fScanners.Script(PRIMARY_SCOPE, (A, 'f'), [Boom('scan failed')])
    with pytest.raises(Boom, match='scan failed'):
        synccoord.TryToScanNow(A, 'f', None, end_in())
    scanner = synchost.fScanners.One(PRIMARY_SCOPE)
    assert scanner.fDestroyCount == 1 and scanner.fSaves == []
    assert synchost.fScanners.Made(SECONDARY_SCOPE) == []
    assert queued(synccoord) == {T1: 2, D1: 2}


@pytest.mark.parametrize('state', [kTimedOut, kReadyToScan], ids=['timed-out', 'ready'])
def test_an_unfinished_scan_stays_queued_and_the_idle_loop_completes_it(synccoord, synchost,
                                                                       state):
    synchost.fInfoCache.Put(scope_info(A, 'f'))
    synchost.fScanners.Script(PRIMARY_SCOPE, (A, 'f'), [state])

    assert synccoord.TryToScanNow(A, 'f', [PRIMARY], end_in()) is None

    first = synchost.fScanners.One(PRIMARY_SCOPE)
    assert first.fSaves == [((), {})]  # the partial results are kept
    assert first.fDestroyCount == 1
    assert queued(synccoord) == {T1: 1}
    assert len(analysis_idles(synccoord)) == 1
    if is_sync_counting(synccoord):
        assert synccoord.Called('AddPairsToPrimaryQueue') == [([(A, 'f')], True, None)]

    synchost.fScanners.Script(PRIMARY_SCOPE, (A, 'f'), [kFinishedScanning])
    assert ostrelgtk.run_until_idle(100)
    rescans = synchost.fScanners.Made(PRIMARY_SCOPE)
    assert len(rescans) == 2 and rescans[1].fScans[-1].state is kFinishedScanning
    assert synccoord.QueuesEmpty()
    assert len(synchost.fScanners.Made(SECONDARY_SCOPE)) == 1


# ---- instance scopes by inference --------------------------------------------------------------

kClassEquivs = {
    'm': method_def('C.m'),
    'x': b':lint',
    'k': b':lint;' + method_def('C.k', bound=True),
    'D': class_def('C.D'),
    'dup': method_def('C.first', bound=True) + b';' + method_def('C.second'),
    'late': method_def('C.late'),
}


@pytest.fixture
def class_c(synchost):
    """Class C of A as the inference engine sees it: four method definitions (one
    without information) among other names."""
    infos = {
        'C': scope_info(A, 'C', kClassEquivs, def_info=class_def('C')),
        'C.m': scope_info(A, 'C.m', {'self.a': b':lint'}, def_info=method_def('C.m')),
        'C.k': None,
        'C.first': scope_info(A, 'C.first', {'self.b': b':lstr'},
                              def_info=method_def('C.first', bound=True)),
        'C.late': scope_info(A, 'C.late', {'self.c': b':lfloat'},
                             def_info=method_def('C.late')),
        'C.second': scope_info(A, 'C.second'),
    }
    synchost.fEngine.fInfos.update({(A, name): info for name, info in infos.items()})
    return infos


def engine_calls(host):
    return [(c.what, *c.args) for c in host.fLog.find('engine')]


def test_instance_scopes_go_to_the_instance_builder(synccoord, synchost, class_c):
    end = end_in()
    result = synccoord.TryToScanNow(A, 'C()', None, end)
    assert result is synchost.fInfoCache.fAdded[0]
    assert result.key.scope_name == 'C()'
    assert synchost.fScanners.Made() == []
    if is_sync_counting(synccoord):
        assert synccoord.Called('_TryToScanInstanceScopeNow') == [(A, 'C()', end)]


def test_no_class_information_or_no_time_left_builds_nothing(synccoord, synchost, class_c):
    end = end_in()
    assert synccoord._TryToScanInstanceScopeNow(A, 'E()', end) is None
    synchost.fEngine.fOutOfTime = [True]
    assert synccoord._TryToScanInstanceScopeNow(A, 'C()', end) is None
    ctxs = synchost.fEngine.fContexts
    assert [c.fEndTime for c in ctxs] == [end, end]
    assert [c for c in engine_calls(synchost) if c[0] == 'GetScopeInfo'] == [
        ('GetScopeInfo', A, 'E', ctxs[0]), ('GetScopeInfo', A, 'C', ctxs[1])]
    assert synchost.fInfoCache.fAdded == []


def test_a_complete_instance_scope_is_stored_and_the_stored_one_returned(
        synccoord, synchost, class_c, inst_spy, other_singleton_manager):
    stored = synchost.fInfoCache.Put(scope_info(A, 'C()'))
    synchost.fInfoCache.fStore = False
    end = end_in()

    assert synccoord._TryToScanInstanceScopeNow(A, 'C()', end) is stored

    ctx = synchost.fEngine.fContexts[0]
    assert engine_calls(synchost) == [
        ('NewContext', end), ('GetScopeInfo', A, 'C', ctx), ('GetScopeInfo', A, 'C.m', ctx),
        ('GetScopeInfo', A, 'C.k', ctx), ('GetScopeInfo', A, 'C.first', ctx),
        ('GetScopeInfo', A, 'C.late', ctx)]
    (args, built), = inst_spy
    assert args == (class_c['C'], [class_c['C.m'], class_c['C.first'], class_c['C.late']],
                    SINGLETON_PRIMARY)
    assert synchost.fInfoCache.fAdded == [built]
    assert built.key.scan_name == SINGLETON_PRIMARY
    assert set(built.type_equivs) >= {'a', 'b', 'c', 'm'}


def test_a_complete_instance_scope_not_found_after_storing_is_returned_as_built(
        synccoord, synchost, class_c, inst_spy):
    synchost.fInfoCache.fStore = False
    result = synccoord._TryToScanInstanceScopeNow(A, 'C()', end_in())
    assert result is inst_spy[0][1]
    assert synchost.fInfoCache.fAdded == [result]
    assert synchost.fLog.args('info_cache', 'GetScopeInfo') == [(A, 'C()')]


def test_running_out_of_time_among_the_methods_keeps_the_result_unstored(
        synccoord, synchost, class_c, inst_spy):
    # Checked after the class, then after each method definition found.
    synchost.fEngine.fOutOfTime = [False, False, False, True]
    result = synccoord._TryToScanInstanceScopeNow(A, 'C()', end_in())

    (args, built), = inst_spy
    assert result is built
    assert args[1] == [class_c['C.m'], class_c['C.first']]
    assert (A, 'C.late') not in [c[1:3] for c in engine_calls(synchost)]
    assert synchost.fInfoCache.fAdded == []
    assert synchost.fLog.find('info_cache', 'GetScopeInfo') == []


@pytest.mark.parametrize('kind', ['str', 'bytearray'])
def test_a_definition_that_is_not_bytes_is_a_type_error(synccoord, synchost, monkeypatch,
                                                        kind):
    packed = method_def('C.m')
    if kind == 'str':
        # The equivalents are bytes, but the split hands back text.
        equivs = {'m': packed}
        real_split = symbolinfo.NonNestedSplit
        monkeypatch.setattr(symbolinfo, 'NonNestedSplit', lambda text, sep: [
            p.decode() for p in real_split(text, sep)])
    else:
        equivs = {'m': bytearray(packed)}
    synchost.fEngine.fInfos[(A, 'C')] = scope_info(A, 'C', equivs)
    synchost.fEngine.fInfos[(A, 'C.m')] = scope_info(A, 'C.m')
    with pytest.raises(TypeError):
        synccoord._TryToScanInstanceScopeNow(A, 'C()', end_in())
    synchost.fInfoCache.Put(scope_info(A, 'C', equivs))
    synchost.fInfoCache.Put(scope_info(A, 'C.m'))
    with pytest.raises(TypeError):
        synccoord.BuildInstanceScopeNoScanning(A, 'C()', end_in())
    assert synchost.fInfoCache.fAdded == []
    assert [c for c in engine_calls(synchost) if c[0] == 'GetScopeInfo'] == [
        ('GetScopeInfo', A, 'C', synchost.fEngine.fContexts[0])]


@pytest.mark.parametrize('method', ['_TryToScanInstanceScopeNow', 'BuildInstanceScopeNoScanning'])
def test_instance_builders_want_an_instance_scope(synccoord, synchost, method):
    with pytest.raises(AssertionError):
        getattr(synccoord, method)(A, 'C', end_in())


# ---- instance scopes from the information cache --------------------------------------------------

@pytest.mark.parametrize('scope, parent', [('C()', ''), ('outer.C()', 'outer')])
def test_without_class_or_parent_the_parent_is_queued(synccoord, synchost, scope, parent):
    assert synccoord.BuildInstanceScopeNoScanning(A, scope, end_in()) is None
    assert queued(synccoord) == {(A, parent, PRIMARY): 1}
    assert synchost.fInfoCache.fAdded == []
    if is_sync_counting(synccoord):
        assert synccoord.Called('AddPairsToPrimaryQueue') == [([(A, parent)], True, None)]


@pytest.mark.parametrize('scope', ['C()', 'E()', 'outer.C()'])
def test_a_class_its_parent_does_not_define_is_stored_as_missing(
        synccoord, synchost, other_singleton_manager, scope):
    parent = symbolinfo.ParentScopeName(scope)
    synchost.fInfoCache.Put(scope_info(A, parent, {'C': b':lint', 'D': class_def('D')},
                                       mtime=42.5))
    result = synccoord.BuildInstanceScopeNoScanning(A, scope, end_in())

    class_name = scope[:-2]
    added = synchost.fInfoCache.fAdded
    assert [info.key for info in added] == [
        scopeinfo.CScopeInfoKey(A, class_name, PRIMARY, A, class_name),
        scopeinfo.CScopeInfoKey(A, scope, PRIMARY, A, scope)]
    for info in added:
        assert (info.def_info, info.disk_mtime, info.incomplete, info.does_not_exist) == (
            b'', 42.5, False, True)
    assert result is added[1]
    assert queued(synccoord) == {}


@pytest.mark.parametrize('scope', ['D()', 'D#2()'])
def test_a_defined_but_unscanned_class_is_queued(synccoord, synchost, scope):
    synchost.fInfoCache.Put(scope_info(A, '', {'D': class_def('D')}))
    assert synccoord.BuildInstanceScopeNoScanning(A, scope, end_in()) is None
    assert queued(synccoord) == {(A, scope[:-2], PRIMARY): 1}
    assert synchost.fInfoCache.fAdded == []


def test_missing_methods_are_queued_in_front(synccoord, synchost, inst_spy):
    cache = synchost.fInfoCache
    cache.Put(scope_info(A, 'C', kClassEquivs))
    cache.Put(scope_info(A, 'C.m'))
    cache.Put(scope_info(A, 'C.late'))
    assert synccoord.BuildInstanceScopeNoScanning(A, 'C()', end_in()) is None
    assert queued(synccoord) == {(A, 'C.k', PRIMARY): 1, (A, 'C.first', PRIMARY): 1}
    assert cache.fAdded == [] and inst_spy == []
    if is_sync_counting(synccoord):
        assert synccoord.Called('AddPairsToPrimaryQueue') == [
            ([(A, 'C.k'), (A, 'C.first')], True, None)]


def test_with_everything_stored_the_instance_scope_is_built(
        synccoord, synchost, inst_spy, other_singleton_manager):
    cache = synchost.fInfoCache
    class_info = cache.Put(scope_info(A, 'C', kClassEquivs))
    methods = [cache.Put(scope_info(A, name)) for name in ('C.m', 'C.k', 'C.first', 'C.late')]

    result = synccoord.BuildInstanceScopeNoScanning(A, 'C()', end_in())

    (args, built), = inst_spy
    assert args == (class_info, methods, SINGLETON_PRIMARY)
    assert result is built
    assert cache.fAdded == [built]
    assert queued(synccoord) == {}
    assert synchost.fLog.find('engine') == []
