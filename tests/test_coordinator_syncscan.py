"""CScanCoordinator: scanning on the caller's stack (`TryToScanDictNow`,
`TryToScanNow`) and the two builders of instance scopes."""
import time

import pytest
import singleton
from coord_doubles import *
from guiutils import ostrelgtk

from pysource import scopeinfo, scopescanner, symbolinfo

A, B = local('pkg/a.py'), local('pkg/b.py')
T1, T2, T3 = (A, 'f', PRIMARY), (A, 'g', PRIMARY), (B, 'h', PRIMARY)
D1, D2 = (A, 'f', DERIVED), (B, 'k', DERIVED)
OUTER_PENDING = (B, 'z', PRIMARY)   # promised by a call further up
OUTER_ACTIVE = (B, 'y', PRIMARY)    # being scanned further up


@pytest.fixture
def sync(host):
    """Only what a test stores is known to the information cache; A and B are open
    in the editor, so queued primary triples keep their scope."""
    host.fInfoCache.fMakeInfos = False
    host.fCacheMgr.OpenBuffer(A)
    host.fCacheMgr.OpenBuffer(B)
    return host


def sets(coord):
    return set(coord._fActiveScanNowTriples), set(coord._fPendingScanNowTriples)


def scanned(host, kind=PRIMARY_SCOPE):
    return [s.fKey for s in host.fScanners.Made(kind)]


def move_clock(monkeypatch, now, state=kFinishedScanning):
    """A scanner step that moves `time.time` to `now`."""
    def step(scanner, end_time):
        monkeypatch.setattr(time, 'time', lambda: now)
        return state
    return step


def test_derived_triples_are_queued_unless_active_or_pending(coord, sync):
    assert coord.TryToScanDictNow(A, 'f', frozenset(), end_in()) is False
    assert sync.fLog == []
    assert coord.TryToScanDictNow(A, 'f', [D1, D2], end_in()) is False
    assert queued(coord) == {D1: 1, D2: 1} and sync.fScanners.Made() == []
    coord.RemoveLocationsFromQueue([A, B])
    coord._fActiveScanNowTriples.add(D1)
    coord._fPendingScanNowTriples.add(D2)
    assert coord.TryToScanDictNow(A, 'f', [D1, D2], end_in()) is False
    assert queued(coord) == {} and sets(coord) == ({D1}, {D2})


def test_primary_triples_are_scanned_in_order(coord, sync):
    seen = []

    def step(scanner, end_time):
        seen.append((scanner.fKey, *sets(coord)))
        return kFinishedScanning

    for triple in (T1, T2, T3):
        sync.fScanners.Script(PRIMARY_SCOPE, triple[:2], [step])
    coord.AddPairsToPrimaryQueue([(A, 'g')], False)
    coord._fActiveScanNowTriples.add(OUTER_ACTIVE)
    end = end_in()
    assert coord.TryToScanDictNow(A, 'f', [T1, D1, OUTER_ACTIVE, T2, T3], end) is True
    # Each triple is active while it is scanned; the ones not reached yet stay promised.
    assert seen == [((A, 'f'), {OUTER_ACTIVE, T1}, {T1, T2, T3}),
                    ((A, 'g'), {OUTER_ACTIVE, T2}, {T2, T3}),
                    ((B, 'h'), {OUTER_ACTIVE, T3}, {T3})]
    assert all(s.fScans == [end] for s in sync.fScanners.Made())
    # The queued primary pair is gone with its scan; the derived one was queued; the
    # triple active further up is neither scanned nor queued.
    assert sync.fScanners.Made(SECONDARY_SCOPE) == [] and queued(coord) == {D1: 1}
    assert sets(coord) == ({OUTER_ACTIVE}, set())


@pytest.mark.parametrize('way_out', ['finished', 'deadline', 'out of time', 'raises',
                                     'clean-up fails', 'bad clock'])
def test_the_triple_sets_are_restored_on_every_way_out(coord, sync, monkeypatch, way_out):
    end = 1000.5
    monkeypatch.setattr(time, 'time', lambda: 1000.0)
    coord._fActiveScanNowTriples.add(OUTER_ACTIVE)
    coord._fPendingScanNowTriples.add(OUTER_PENDING)
    after = {'deadline': end, 'out of time': end + 0.1, 'bad clock': 'soon'}.get(way_out)
    if after is not None:
        sync.fScanners.Script(PRIMARY_SCOPE, (A, 'f'), [move_clock(monkeypatch, after)])
    if way_out in ('raises', 'clean-up fails'):
        sync.fScanners.Script(PRIMARY_SCOPE, (A, 'g'), [Boom('scan failed')])
    if way_out == 'clean-up fails':
        sync.fCacheMgr.DoesCacheBufferExist = 5  # queueing what is left fails in C code
    needs = [T1, OUTER_ACTIVE, T2, T3]
    raised = {'raises': Boom, 'clean-up fails': TypeError, 'bad clock': TypeError}.get(way_out)
    if raised:
        with pytest.raises(raised) as info:
            coord.TryToScanDictNow(A, 'f', needs, end)
        # A failing clean-up keeps the scan's exception as its context.
        assert isinstance(info.value.__context__, Boom) is (way_out == 'clean-up fails')
    else:
        assert coord.TryToScanDictNow(A, 'f', needs, end) is (way_out != 'out of time')
    assert sets(coord) == ({OUTER_ACTIVE}, {OUTER_PENDING})
    assert all(s.fDestroyCount == 1 for s in sync.fScanners.Made())
    # What was not scanned is queued, the scan that ran out of time too; reaching the
    # deadline exactly is not running out.
    assert queued(coord) == {'out of time': {T1: 1, T2: 1, T3: 1}, 'raises': {T2: 1, T3: 1},
                             'bad clock': {T1: 1, T2: 1, T3: 1}}.get(way_out, {})
    assert (B, 'y') not in scanned(sync)


def test_reentry_for_the_triple_being_scanned(coord, sync):
    nested = []

    def step(scanner, end_time):
        nested.append((coord.TryToScanDictNow(A, 'f', [T1], end_time), sets(coord)))
        return kFinishedScanning

    sync.fScanners.Script(PRIMARY_SCOPE, (A, 'f'), [step])
    assert coord.TryToScanDictNow(A, 'f', [T1], end_in()) is True
    assert nested == [(False, ({T1}, {T1}))]
    assert scanned(sync) == [(A, 'f')] and queued(coord) == {} and sets(coord) == (set(), set())


def test_reentry_serves_a_promised_triple_once(coord, sync):
    nested = []

    def step(scanner, end_time):
        nested.append(coord.TryToScanDictNow(A, 'g', [T1, T2, T3, D1], end_time))
        nested.append(sets(coord))
        return kFinishedScanning

    sync.fScanners.Script(PRIMARY_SCOPE, (A, 'f'), [step])
    assert coord.TryToScanDictNow(A, 'f', [T1, T2], end_in()) is True
    # The nested call skipped the active triple and scanned the promised one and its
    # own new one; the outer call then did not scan the promised one again, but
    # queues it, as it had promised it and did not scan it itself.
    assert nested == [True, ({T1}, {T1})]
    assert scanned(sync) == [(A, 'f'), (A, 'g'), (B, 'h')]
    assert sets(coord) == (set(), set()) and queued(coord) == {D1: 1, T2: 1}


@pytest.mark.parametrize('script, answer, left', [
    ({'file_doesnt_exist': True}, (False, None, None), {D1: 2}),
    ({'states': [kWaitingForData]}, (True, None, None), {T1: 1, D1: 2}),
])
def test_the_two_shared_answers(coord, sync, script, answer, left):
    coord.AddPairsToPrimaryQueue([(A, 'f')], False)
    coord.AddPairsToSecondaryQueue([(A, 'f')], False)
    sync.fScanners.Script(PRIMARY_SCOPE, (A, 'f'), **script)
    sync.fScanners.Script(PRIMARY_SCOPE, (B, 'h'), **script)
    first = coord.TryToScanNow(A, 'f', None, end_in())
    assert first == answer and coord.TryToScanNow(B, 'h', [PRIMARY], end_in()) is first
    # Nothing saved, no secondary scan; waiting work is queued again in front.
    assert queued(coord) == {**left, **({T3: 1} if answer[0] else {})}
    assert [(s.kKind, s.fDestroyCount, s.fSaves) for s in sync.fScanners.Made()] == [
        (PRIMARY_SCOPE, 1, [])] * 2


@pytest.mark.parametrize('state', [kFinishedScanning, kScanAbandoned])
def test_a_completed_scan_is_saved_and_followed_by_the_secondary_scan(coord, sync, state):
    info = sync.fInfoCache.Put(scope_info(B, 'h'))
    coord.AddPairsToPrimaryQueue([(B, 'h')], False)
    coord.AddPairsToSecondaryQueue([(B, 'h')], False)
    sync.fScanners.Script(PRIMARY_SCOPE, (B, 'h'), [state])
    end = end_in()
    assert coord.TryToScanNow(B, 'h', None, end) is None
    primary, secondary = sync.fScanners.Made()
    assert primary.fKwargs['incomplete_scope_set'] is coord._fIncompleteScansByLoc[B]
    assert secondary.fArgs == (info, coord.fLog, None, sync.fAnaMgr)
    assert primary.fScans == secondary.fScans == [end] and queued(coord) == {}
    assert [c.what for c in sync.fLog.find('scanner')] == [
        'create', 'Scan', 'SaveToInfoCache', 'destroy', 'create', 'Scan', 'destroy']


@pytest.mark.parametrize('names, kinds', [
    ([DERIVED], [SECONDARY_SCOPE]), ([PRIMARY], [PRIMARY_SCOPE]),
    ([DERIVED, PRIMARY], [PRIMARY_SCOPE, SECONDARY_SCOPE]), (['another-scan'], [])])
def test_the_scan_name_list_chooses_the_scans(coord, sync, names, kinds):
    sync.fInfoCache.Put(scope_info(A, 'f'))
    coord.AddPairsToPrimaryQueue([(A, 'f')], False)
    coord.AddPairsToSecondaryQueue([(A, 'f')], False)
    assert coord.TryToScanNow(A, 'f', names, end_in()) is None
    assert [s.kKind for s in sync.fScanners.Made()] == kinds
    assert queued(coord) == {t: 2 for t in (T1, D1) if t[2] not in names}


def test_a_secondary_scan_still_running_keeps_its_queue_entry(coord, sync):
    sync.fInfoCache.Put(scope_info(A, 'f'))
    coord.AddPairsToSecondaryQueue([(A, 'f')], False)
    sync.fScanners.Script(SECONDARY_SCOPE, (A, 'f'), [kTimedOut, kFinishedScanning])
    coord.TryToScanNow(A, 'f', [DERIVED], end_in())
    scanner = sync.fScanners.One()
    assert queued(coord) == {D1: 2} and active(coord, SECONDARY_SCOPE) == {(A, 'f'): scanner}
    coord.TryToScanNow(A, 'f', [DERIVED], end_in())  # continues the same scanner
    assert sync.fScanners.Made() == [scanner] and scanner.fDestroyCount == 1
    assert queued(coord) == {}
    coord.AddPairsToSecondaryQueue([(A, 'f')], False)
    sync.fLocCache.fAnswers[A] = False  # not wanted: dropped from the queue
    coord.TryToScanNow(A, 'f', [DERIVED], end_in())
    assert queued(coord) == {} and len(sync.fScanners.Made()) == 1


def test_a_raising_scan_still_destroys_its_scanner(coord, sync):
    coord.AddPairsToPrimaryQueue([(A, 'f')], False)
    sync.fScanners.Script(PRIMARY_SCOPE, (A, 'f'), [Boom('scan failed')])
    with pytest.raises(Boom):
        coord.TryToScanNow(A, 'f', None, end_in())
    scanner = sync.fScanners.One()
    assert scanner.fDestroyCount == 1 and scanner.fSaves == [] and queued(coord) == {T1: 2}


@pytest.mark.parametrize('state', [kTimedOut, kReadyToScan])
def test_an_unfinished_scan_stays_queued_and_the_idle_loop_completes_it(coord, sync, state):
    sync.fInfoCache.Put(scope_info(A, 'f'))
    sync.fScanners.Script(PRIMARY_SCOPE, (A, 'f'), [state])
    assert coord.TryToScanNow(A, 'f', [PRIMARY], end_in()) is None
    first = sync.fScanners.One()
    assert first.fSaves == [()] and first.fDestroyCount == 1  # partial results are kept
    assert queued(coord) == {T1: 1} and len(pending_callbacks(coord)) == 1
    sync.fScanners.Script(PRIMARY_SCOPE, (A, 'f'), [kFinishedScanning])
    assert ostrelgtk.run_until_idle(100)
    assert len(sync.fScanners.Made(PRIMARY_SCOPE)) == 2 and coord.QueuesEmpty()


kClassEquivs = {
    'm': method_def('C.m'), 'x': b':lint', 'k': b':lint;' + method_def('C.k', bound=True),
    'D': class_def('C.D'), 'dup': method_def('C.first', bound=True) + b';' + method_def('C.second'),
    'late': method_def('C.late')}


@pytest.fixture
def class_c(sync):
    """Class C of A as the inference engine sees it: four method definitions (one
    without information) among other names."""
    infos = {
        'C': scope_info(A, 'C', kClassEquivs, def_info=class_def('C')),
        'C.m': scope_info(A, 'C.m', {'self.a': b':lint'}, method_def('C.m')), 'C.k': None,
        'C.first': scope_info(A, 'C.first', {'self.b': b':lstr'}, method_def('C.first', True)),
        'C.late': scope_info(A, 'C.late', {'self.c': b':lfloat'}, method_def('C.late')),
        'C.second': scope_info(A, 'C.second')}
    sync.fEngine.fInfos.update({(A, name): info for name, info in infos.items()})
    return infos


@pytest.fixture
def inst_spy(monkeypatch):
    """The calls of scopescanner.CreateClassInstInfo, with what each returned."""
    calls = []
    real = scopescanner.CreateClassInstInfo

    def spy(class_info, method_infos, scan_name):
        calls.append(((class_info, list(method_infos), scan_name),
                      real(class_info, method_infos, scan_name)))
        return calls[-1][1]

    monkeypatch.setattr(scopescanner, 'CreateClassInstInfo', spy)
    # The application-wide manager names another primary scan than the coordinator's.
    singleton.SetSingleton('fAnalysisMgr', type('Mgr', (), {'fPrimaryScanName': 'app'})())
    return calls


def engine_lookups(host):
    return [c.args[:2] for c in host.fLog.find('engine', 'GetScopeInfo')]


def test_instance_scopes_by_inference(coord, sync, class_c, inst_spy):
    end = end_in()
    assert coord._TryToScanInstanceScopeNow(A, 'E()', end) is None  # no class information
    sync.fEngine.fOutOfTime = [True]
    assert coord._TryToScanInstanceScopeNow(A, 'C()', end) is None  # no time left
    assert [c.fEndTime for c in sync.fEngine.fContexts] == [end, end]
    sync.fEngine.fOutOfTime = [False]
    sync.fLog.clear()
    result = coord.TryToScanNow(A, 'C()', None, end)
    assert engine_lookups(sync) == [(A, 'C'), (A, 'C.m'), (A, 'C.k'), (A, 'C.first'),
                                    (A, 'C.late')]
    ((args, built),) = inst_spy
    assert args == (class_c['C'], [class_c['C.m'], class_c['C.first'], class_c['C.late']], 'app')
    assert sync.fInfoCache.fAdded == [built] and result is built
    assert set(built.type_equivs) >= {'a', 'b', 'c', 'm'} and sync.fScanners.Made() == []


def test_a_stored_instance_scope_is_returned_after_storing(coord, sync, class_c, inst_spy):
    stored = sync.fInfoCache.Put(scope_info(A, 'C()'))
    sync.fInfoCache.fStore = False
    assert coord._TryToScanInstanceScopeNow(A, 'C()', end_in()) is stored
    assert sync.fInfoCache.fAdded == [inst_spy[0][1]]


def test_running_out_of_time_among_the_methods_keeps_the_result_unstored(coord, sync, class_c,
                                                                       inst_spy):
    sync.fEngine.fOutOfTime = [False, False, False, True]  # after the class, then per method
    result = coord._TryToScanInstanceScopeNow(A, 'C()', end_in())
    ((args, built),) = inst_spy
    assert result is built and args[1] == [class_c['C.m'], class_c['C.first']]
    assert (A, 'C.late') not in engine_lookups(sync) and sync.fInfoCache.fAdded == []


def test_a_definition_that_is_not_bytes_is_a_type_error(coord, sync):
    equivs = {'m': bytearray(method_def('C.m'))}
    sync.fEngine.fInfos[(A, 'C')] = scope_info(A, 'C', equivs)
    sync.fEngine.fInfos[(A, 'C.m')] = scope_info(A, 'C.m')
    with pytest.raises(TypeError):
        coord._TryToScanInstanceScopeNow(A, 'C()', end_in())
    sync.fInfoCache.Put(scope_info(A, 'C', equivs))
    sync.fInfoCache.Put(scope_info(A, 'C.m'))
    with pytest.raises(TypeError):
        coord.BuildInstanceScopeNoScanning(A, 'C()', end_in())
    assert sync.fInfoCache.fAdded == [] and engine_lookups(sync) == [(A, 'C')]


@pytest.mark.parametrize('method', ['_TryToScanInstanceScopeNow', 'BuildInstanceScopeNoScanning'])
def test_instance_builders_want_an_instance_scope(coord, sync, method):
    with pytest.raises(AssertionError):
        getattr(coord, method)(A, 'C', end_in())


@pytest.mark.parametrize('scope', ['C()', 'outer.C()'])
def test_a_class_its_parent_does_not_define(coord, sync, inst_spy, scope):
    parent = symbolinfo.ParentScopeName(scope)
    assert coord.BuildInstanceScopeNoScanning(A, scope, end_in()) is None
    assert queued(coord) == {(A, parent, PRIMARY): 1}  # no parent yet: it is queued
    coord.RemoveLocationsFromQueue([A])
    sync.fInfoCache.Put(scope_info(A, parent, {'C': b':lint', 'D': class_def('D')}, mtime=42.5))
    result = coord.BuildInstanceScopeNoScanning(A, scope, end_in())
    # The class and its instance scope are stored as missing.
    added = sync.fInfoCache.fAdded
    assert [info.key for info in added] == [
        scopeinfo.CScopeInfoKey(A, scope[:-2], PRIMARY, A, scope[:-2]),
        scopeinfo.CScopeInfoKey(A, scope, PRIMARY, A, scope)]
    assert all((i.def_info, i.disk_mtime, i.incomplete, i.does_not_exist) ==
               (b'', 42.5, False, True)
               for i in added)
    assert result is added[1] and queued(coord) == {}


@pytest.mark.parametrize('scope', ['D()', 'D#2()'])
def test_a_defined_but_unscanned_class_is_queued(coord, sync, scope):
    sync.fInfoCache.Put(scope_info(A, '', {'D': class_def('D')}))
    assert coord.BuildInstanceScopeNoScanning(A, scope, end_in()) is None
    assert queued(coord) == {(A, scope[:-2], PRIMARY): 1} and sync.fInfoCache.fAdded == []


def test_the_instance_scope_from_stored_information(coord, sync, inst_spy):
    cache = sync.fInfoCache
    class_info = cache.Put(scope_info(A, 'C', kClassEquivs))
    cache.Put(scope_info(A, 'C.m'))
    cache.Put(scope_info(A, 'C.late'))
    assert coord.BuildInstanceScopeNoScanning(A, 'C()', end_in()) is None
    # Missing methods are queued in front, and nothing is built yet.
    assert queued(coord) == {(A, 'C.k', PRIMARY): 1, (A, 'C.first', PRIMARY): 1}
    assert inst_spy == []
    methods = [cache.fScopeInfos[(A, 'C.m')], cache.Put(scope_info(A, 'C.k')),
               cache.Put(scope_info(A, 'C.first')), cache.fScopeInfos[(A, 'C.late')]]
    result = coord.BuildInstanceScopeNoScanning(A, 'C()', end_in())
    ((args, built),) = inst_spy
    assert args == (class_info, methods, 'app') and result is built
    assert cache.fAdded == [built] and sync.fLog.find('engine') == []
