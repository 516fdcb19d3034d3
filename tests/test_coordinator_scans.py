"""CScanCoordinator: running primary and secondary scans.

Covers the four scan methods: the scanner each creates and its arguments,
resuming one scanner over several slices, waiting for data (primary items
parked until the scanner's signal, secondary items left queued), the follow-up
work of finished and abandoned scans (imports, secondary locations, secondary
scans, instance scopes), the incomplete-scope sets, the early returns of the
secondary methods, and scanners that raise.

Tests that take `scoord` run on the class and on ScanCountingCoordinator; on
the latter they also check the calls of the coordinator's own operations.
"""
import gc
import time
import weakref

import pytest
import singleton
from coord_doubles import *
from coord_doubles import (
    DERIVED,
    PRIMARY,
    Boom,
    analysis_idles,
    local,
    make_coord,
    queued,
    record_signals,
)
from guiutils import ostrelgtk
from scan_doubles import *
from scan_doubles import (
    PRIMARY_SCOPE,
    PRIMARY_WHOLE,
    SECONDARY_SCOPE,
    SECONDARY_WHOLE,
    FakeScopeInfo,
    ScanAnalysis,
    ScanCountingCoordinator,
    ScanHost,
    active,
    add_incomplete,
    data_waiting,
    info_with_equivs,
    is_counting,
    kFinishedScanning,
    kReadyToScan,
    kScanAbandoned,
    kTimedOut,
    kWaitingForData,
    scope_def,
    take_over_idle,
)

from pysource import logicalline, scancoordinator

CScanItem = scancoordinator.CScanItem

A = local('pkg/a.py')
B = local('pkg/b.py')
PKG = local('pkg')

kMethods = {
    PRIMARY_WHOLE: '_CScanCoordinator__DoPrimaryWholeFileScan',
    PRIMARY_SCOPE: '_CScanCoordinator__DoPrimarySingleScopeScan',
    SECONDARY_WHOLE: '_CScanCoordinator__DoSecondaryWholeFileScan',
    SECONDARY_SCOPE: '_CScanCoordinator__DoSecondarySingleScopeScan',
}
kItems = {
    PRIMARY_WHOLE: CScanItem(A, '*', PRIMARY, 1),
    PRIMARY_SCOPE: CScanItem(A, 'C.m', PRIMARY, 1),
    SECONDARY_WHOLE: CScanItem(A, '*', DERIVED, 1),
    SECONDARY_SCOPE: CScanItem(A, 'C.m', DERIVED, 1),
}
kKeys = {PRIMARY_WHOLE: A, PRIMARY_SCOPE: (A, 'C.m'), SECONDARY_WHOLE: A,
         SECONDARY_SCOPE: (A, 'C.m')}


def run_scan(coord, kind, end_time=None, item=None):
    """One call of the scan method of `kind` for its standard item."""
    item = item or kItems[kind]
    end_time = time.time() + 5 if end_time is None else end_time
    method = getattr(coord, kMethods[kind])
    if kind == SECONDARY_SCOPE:
        return method(item.loc, item.scope_name, end_time)
    return method(item, end_time)


def queue_item(coord, item):
    if item.scan_name == PRIMARY:
        coord.AddPairsToPrimaryQueue([(item.loc, item.scope_name)], priority=item.priority)
    else:
        coord.AddPairsToSecondaryQueue([(item.loc, item.scope_name)], priority=item.priority)


# ---- scanners and their slices --------------------------------------------------------

@pytest.mark.parametrize('kind', list(kMethods))
def test_one_scanner_runs_a_scan_over_several_slices(scoord, shost, kind):
    key = kKeys[kind]
    shost.fScanners.Script(kind, key, [kReadyToScan, kTimedOut, kFinishedScanning])
    ends = [time.time() + 5 + i for i in range(3)]

    assert run_scan(scoord, kind, ends[0]) is True
    scanner = shost.fScanners.One(kind, key)
    assert active(scoord, kind) == {key: scanner}
    assert run_scan(scoord, kind, ends[1]) is True
    assert active(scoord, kind) == {key: scanner}
    assert scanner.fDestroyCount == 0
    assert run_scan(scoord, kind, ends[2]) is False

    assert shost.fScanners.Made() == [scanner]
    assert [s.end_time for s in scanner.fScans] == ends
    assert active(scoord, kind) == {}
    assert scanner.fDestroyCount == 1
    starts = [m for m in scoord.fLog.Messages() if m.lower().startswith('starting')]
    assert len(starts) == (0 if kind == SECONDARY_SCOPE else 1)


def test_scanner_arguments(scoord, shost):
    for kind in kMethods:
        shost.fScanners.Script(kind, kKeys[kind], [kReadyToScan])
        assert run_scan(scoord, kind) is True
    incomplete = scoord._fIncompleteScansByLoc[A]
    pw, ps, sw, ss = (shost.fScanners.One(kind) for kind in kMethods)
    assert pw.fArgs == (A, PRIMARY)
    assert ps.fArgs == (A, 'C.m')
    for scanner in (pw, ps):
        assert scanner.fKwargs['incomplete_scope_set'] is incomplete
        assert scanner.fKwargs['log'] is scoord.fLog
    assert sw.fArgs == (A, DERIVED, scoord.fLog)
    info = shost.fInfoCache.fScopeInfos[(A, 'C.m')]
    assert ss.fArgs == (info, scoord.fLog, None, shost.fAnaMgr)
    assert ss.fArgs[0] is info


def test_log_messages_pass_their_values_separately(scoord, shost):
    for kind in kMethods:
        run_scan(scoord, kind)
    assert scoord.fLog.fCalls == [
        ('Starting primary whole file scan: %r', (A,)),
        ('Finished primary whole file scan: %r', (A,)),
        ('starting primary scope scan: scope=%r, file=%r', ('C.m', A)),
        ('finished primary scope scan: scope=%r, file=%r, changed=%s', ('C.m', A, True)),
        ('Starting secondary whole file scan: %r', (A,)),
        ('Finished secondary whole file scan: %r', (A,)),
    ]


@pytest.mark.parametrize('kind', list(kMethods))
def test_a_raising_scanner_stays_active_and_is_resumed(scoord, shost, kind):
    key = kKeys[kind]
    shost.fScanners.Script(kind, key, [Boom('scan failed'), kFinishedScanning])
    with pytest.raises(Boom):
        run_scan(scoord, kind)
    scanner = shost.fScanners.One(kind, key)
    assert active(scoord, kind) == {key: scanner}
    assert scanner.fDestroyCount == 0
    assert run_scan(scoord, kind) is False
    assert shost.fScanners.Made() == [scanner]
    assert active(scoord, kind) == {}


@pytest.mark.parametrize('kind', list(kMethods))
def test_an_abandoned_scan_is_ended(scoord, shost, kind):
    shost.fScanners.Script(kind, kKeys[kind], [kScanAbandoned])
    assert run_scan(scoord, kind) is False
    scanner = shost.fScanners.One(kind)
    assert active(scoord, kind) == {}
    assert scanner.fDestroyCount == 1


# ---- waiting for data ------------------------------------------------------------------

@pytest.mark.parametrize('kind', [PRIMARY_WHOLE, PRIMARY_SCOPE])
def test_primary_item_waits_for_its_scanners_data(scoord, shost, kind):
    item, key = kItems[kind], kKeys[kind]
    shost.fScanners.Script(kind, key, [kWaitingForData, kFinishedScanning])
    shost.fLocCache.fAnswers[A] = False  # no secondary scans to follow
    record_signals(scoord, shost.fLog, 'scheduled')
    queue_item(scoord, item)
    take_over_idle(scoord)

    assert scoord._CB_DoIdleAnalysis() is False
    scanner = shost.fScanners.One(kind, key)
    assert queued(scoord) == {}
    assert data_waiting(scoord) == {tuple(item)}
    assert scanner.Connections() == 1
    assert active(scoord, kind) == {key: scanner}
    # While the scanner is silent the item is not handed out again.
    scoord._CB_DoIdleAnalysis()
    assert len(scanner.fScans) == 1
    if is_counting(scoord):
        assert scoord.Called('_WaitForScannerToBeReady') == [(scanner, item)]

    shost.fLog.clear()
    scanner.emit('scan-state-changed', scanner)
    assert queued(scoord) == {item[:3]: item.priority}
    assert data_waiting(scoord) == set()
    assert [c.what for c in shost.fLog.find('signal')] == ['scheduled']
    assert len(analysis_idles(scoord)) == 1
    assert scanner.Connections() == 0

    # A second emission finds no handler: nothing is scheduled again.
    scoord._CancelIdle()
    shost.fLog.clear()
    scanner.emit('scan-state-changed', scanner)
    assert shost.fLog.find('signal') == [] and analysis_idles(scoord) == []
    assert queued(scoord) == {item[:3]: item.priority}

    assert scoord._CB_DoIdleAnalysis() is False
    assert shost.fScanners.Made(kind) == [scanner]
    assert len(scanner.fScans) == 2
    assert queued(scoord) == {} and scoord.QueuesEmpty()
    starts = [m for m in scoord.fLog.Messages() if m.lower().startswith('starting')]
    assert len(starts) == 1


def test_waiting_ends_with_the_coordinator(shost):
    coord = make_coord(ScanCountingCoordinator, shost)
    shost.fScanners.Script(PRIMARY_WHOLE, A, [kWaitingForData])
    queue_item(coord, kItems[PRIMARY_WHOLE])
    coord._CB_DoIdleAnalysis()
    scanner = shost.fScanners.One(PRIMARY_WHOLE, A)
    assert scanner.Connections() == 1
    coord.destroy()
    assert scanner.Connections() == 0


@pytest.mark.parametrize('kind', [SECONDARY_WHOLE, SECONDARY_SCOPE])
def test_secondary_item_waiting_for_data_stays_queued(scoord, shost, kind):
    item, key = kItems[kind], kKeys[kind]
    shost.fScanners.Script(kind, key, [kWaitingForData, kWaitingForData, kFinishedScanning])
    queue_item(scoord, item)

    assert scoord._CB_DoIdleAnalysis() is True
    assert queued(scoord) == {item[:3]: item.priority}
    assert data_waiting(scoord) == set()
    assert scoord._CB_DoIdleAnalysis() is True
    assert scoord._CB_DoIdleAnalysis() is False
    scanner = shost.fScanners.One(kind, key)
    assert len(scanner.fScans) == 3 and scanner.Connections() == 0
    if is_counting(scoord):
        assert scoord.Called('_WaitForScannerToBeReady') == []


# ---- whole-file primary scans ------------------------------------------------------------

def test_finished_whole_file_scan_queues_its_follow_up_work(scoord, shost):
    sec1, sec2, mod = local('pkg/a_impl.py'), local('other/a_data.py'), local('lib/os.py')
    shost.fFactory.fSecondaryLocs[A] = (loc for loc in [sec1, sec2])
    shost.fFactory.fModuleLocs['os'] = mod
    shost.fInfoCache.fImports[A] = [b':ios', b':lint']
    item = CScanItem(A, '*', PRIMARY, 0)

    assert run_scan(scoord, PRIMARY_WHOLE, item=item) is False

    assert queued(scoord) == {(mod, '*', PRIMARY): 0, (sec1, '*', PRIMARY): 0,
                              (sec2, '*', PRIMARY): 0, (A, '*', DERIVED): 0}
    assert shost.fLog.args('info_cache', 'GetAllImports') == [([A],)]
    assert shost.fLog.args('factory', '_FindPrimaryLocsForNames') == [({'os'}, PKG, False)]
    calls = [(c.who, c.what) for c in shost.fLog if c.who in ('scanner', 'factory')
             or c.what in ('GetAllImports', 'WantDerivedInfo')]
    assert calls == [('scanner', 'create'), ('scanner', 'Scan'), ('scanner', 'destroy'),
                     ('info_cache', 'GetAllImports'), ('factory', '_FindPrimaryLocsForNames'),
                     ('factory', 'GetSecondaryLocations'), ('loc_cache', 'WantDerivedInfo')]
    if is_counting(scoord):
        assert scoord.Called('__AddImportEquivsToQueue') == [([b':ios', b':lint'], PKG, 0)]
        assert scoord.Called('AddPairsToPrimaryQueue') == [
            ([(mod, '*')], False, 0), ([(sec1, '*'), (sec2, '*')], True, 0)]
        assert scoord.Called('AddPairsToSecondaryQueue') == [([(A, '*')], True, 0)]


def test_whole_file_scan_without_imports_still_queues_its_secondary_scan(scoord, shost):
    assert run_scan(scoord, PRIMARY_WHOLE, item=CScanItem(A, '*', PRIMARY, 2)) is False
    assert queued(scoord) == {(A, '*', DERIVED): 2}
    assert shost.fLog.find('factory', '_FindPrimaryLocsForNames') == []
    if is_counting(scoord):
        assert scoord.Called('__AddImportEquivsToQueue') == [([], PKG, 2)]
        assert scoord.Called('AddPairsToPrimaryQueue') == []


def test_abandoned_whole_file_scan_queues_nothing(scoord, shost):
    shost.fScanners.Script(PRIMARY_WHOLE, A, [add_incomplete(set(), kScanAbandoned)])
    shost.fInfoCache.fImports[A] = [b':ios']
    assert run_scan(scoord, PRIMARY_WHOLE) is False
    assert queued(scoord) == {}
    assert A in scoord._fIncompleteScansByLoc  # created for the scanner, left alone
    assert shost.fLog.find('info_cache', 'GetAllImports') == []
    assert scoord.fLog.Messages() == [f'Starting primary whole file scan: {A!r}',
                                      f'Finished primary whole file scan: {A!r}']


@pytest.mark.parametrize('found, kept', [(set(), False), ({'C.m', 'f'}, True)])
def test_incomplete_scopes_of_a_whole_file(scoord, shost, found, kept):
    shost.fScanners.Script(PRIMARY_WHOLE, A, [add_incomplete(found)])
    assert run_scan(scoord, PRIMARY_WHOLE) is False
    scanner = shost.fScanners.One(PRIMARY_WHOLE)
    if kept:
        assert scoord._fIncompleteScansByLoc[A] is scanner.fKwargs['incomplete_scope_set']
        assert scoord._fIncompleteScansByLoc[A] == found
    else:
        assert A not in scoord._fIncompleteScansByLoc


def test_secondary_locations_come_from_the_application_analysis_manager(scoord, shost):
    other = ScanHost()
    sec = local('pkg/a_impl.py')
    other.fFactory.fSecondaryLocs[A] = [sec]
    shost.fFactory.fSecondaryLocs[A] = [local('wrong.py')]
    singleton.SetSingleton('fAnalysisMgr', other.fAnaMgr)
    try:
        run_scan(scoord, PRIMARY_WHOLE)
        assert queued(scoord) == {(sec, '*', PRIMARY): 1, (A, '*', DERIVED): 1}
    finally:
        other.Destroy()


# ---- single-scope primary scans --------------------------------------------------------

def test_single_scope_scan_refreshes_an_existing_analysis(scoord, shost):
    ana = ScanAnalysis(A, shost.fLog)
    shost.fCacheMgr.fAnalyses[A] = ana
    shost.fScanners.Script(PRIMARY_SCOPE, (A, 'C.m'), [kReadyToScan, kFinishedScanning])
    run_scan(scoord, PRIMARY_SCOPE)
    run_scan(scoord, PRIMARY_SCOPE)
    # Once, when the scanner is made, and before it is made.
    assert [c[:2] for c in (shost.fLog.names()) if c[0] in ('analysis', 'scanner')][:2] == [
        ('analysis', 'UpdateFromCache'), ('scanner', 'create')]
    assert len(shost.fLog.find('analysis', 'UpdateFromCache')) == 1
    assert shost.fLog.args('cache_mgr', 'GetAnalysis') == [(A, False)]


def test_single_scope_scan_without_analysis(scoord, shost):
    shost.fCacheMgr.fAnalyses[A] = object()  # not a source analysis: ignored
    run_scan(scoord, PRIMARY_SCOPE)
    assert shost.fLog.args('cache_mgr', 'GetAnalysis') == [(A, False)]
    assert len(shost.fScanners.Made(PRIMARY_SCOPE)) == 1


def test_unchanged_scope_queues_nothing(scoord, shost):
    shost.fScanners.Script(PRIMARY_SCOPE, (A, 'C'), changed=False,
                           info=info_with_equivs(os=b':ios'),
                           scope_def=scope_def(logicalline.kClassDef))
    assert run_scan(scoord, PRIMARY_SCOPE, item=CScanItem(A, 'C', PRIMARY, 1)) is False
    scanner = shost.fScanners.One(PRIMARY_SCOPE)
    assert scanner.fSaves == [((False,), {})]
    assert scanner.fDestroyCount == 1
    assert queued(scoord) == {}
    assert shost.fLog.find('factory') == []
    assert scoord.fLog.Messages()[-1] == (
        f"finished primary scope scan: scope='C', file={A!r}, changed=False")


@pytest.mark.parametrize('scope, sdef, containing, instance', [
    ('C', logicalline.kClassDef, None, 'C()'),
    ('C.m', logicalline.kFunctionDef, logicalline.kClassDef, 'C()'),
    ('Outer.Inner.m', logicalline.kFunctionDef, logicalline.kClassDef, 'Outer.Inner()'),
    ('f', logicalline.kFunctionDef, None, None),
    ('', None, None, None),
])
def test_changed_scope_queues_secondary_scan_and_instance_scope(scoord, shost, scope, sdef,
                                                                containing, instance):
    shost.fScanners.Script(
        PRIMARY_SCOPE, (A, scope),
        scope_def=None if sdef is None else scope_def(sdef),
        containing_class_def=None if containing is None else scope_def(containing))
    item = CScanItem(A, scope, PRIMARY, 2)
    assert scoord._DoSingleScan(item, time.time() + 5) is False

    expected = {(A, scope, DERIVED): 2}
    if instance is not None:
        expected[(A, instance, PRIMARY)] = 2
    assert queued(scoord) == expected
    assert shost.fLog.find('factory', '_FindPrimaryLocsForNames') == []
    if is_counting(scoord):
        assert scoord.Called('AddPairsToSecondaryQueue') == [([(A, scope)], False, None)]
        assert scoord.Called('AddPairsToPrimaryQueue') == (
            [] if instance is None else [([(A, instance)], True, None)])
        assert scoord.Called('__AddImportEquivsToQueue') == []


def test_changed_scope_queues_its_imports(scoord, shost):
    mods = {'os': local('lib/os.py'), 'json': local('lib/json/__init__.py'),
            'json.decoder': local('lib/json/decoder.py')}
    shost.fFactory.fModuleLocs.update(mods)
    info = info_with_equivs(os=b':ios;x.y', loads=b':fjson.decoder loads',
                            data=b':lint', path=b'os.path;:ios')
    shost.fScanners.Script(PRIMARY_SCOPE, (A, 'f'), info=info)
    assert scoord._DoSingleScan(CScanItem(A, 'f', PRIMARY, 1), time.time() + 5) is False
    [(names, dirloc, flag)] = shost.fLog.args('factory', '_FindPrimaryLocsForNames')
    assert names == {'os', 'json.decoder.loads', 'json.decoder', 'json'}
    assert (dirloc, flag) == (PKG, False)
    assert queued(scoord) == {(A, 'f', DERIVED): 1, **{(loc, '*', PRIMARY): 1
                                                      for loc in mods.values()}}
    if is_counting(scoord):
        assert scoord.Called('__AddImportEquivsToQueue') == [
            ([b':ios', b':fjson.decoder loads', b':ios'], PKG, 1)]


def test_abandoned_scope_is_saved_and_followed_up_when_changed(scoord, shost):
    shost.fScanners.Script(PRIMARY_SCOPE, (A, 'C'), [kScanAbandoned],
                           scope_def=scope_def(logicalline.kClassDef))
    assert scoord._DoSingleScan(CScanItem(A, 'C', PRIMARY, 1), time.time() + 5) is False
    assert shost.fScanners.One(PRIMARY_SCOPE).fSaves == [((False,), {})]
    assert queued(scoord) == {(A, 'C', DERIVED): 1, (A, 'C()', PRIMARY): 1}


def test_instance_scope_is_built_without_a_scanner(shost):
    class Building(ScanCountingCoordinator):
        def BuildInstanceScopeNoScanning(self, loc, scope_name, end_time):
            self.fCalls.append(('BuildInstanceScopeNoScanning', loc, scope_name, end_time))
            return 'a result nobody looks at'

    coord = make_coord(Building, shost)
    end_time = time.time() + 5
    item = CScanItem(A, 'C()', PRIMARY, 1)
    assert coord._CScanCoordinator__DoPrimarySingleScopeScan(item, end_time) is False
    assert coord.Called('BuildInstanceScopeNoScanning') == [(A, 'C()', end_time)]
    assert shost.fScanners.Made() == []
    assert A not in coord._fIncompleteScansByLoc
    coord.destroy()


# ---- secondary scans ---------------------------------------------------------------------

@pytest.mark.parametrize('kind', [SECONDARY_WHOLE, SECONDARY_SCOPE])
def test_secondary_scans_not_wanted(scoord, shost, kind):
    key = kKeys[kind]
    shost.fScanners.Script(kind, key, [kReadyToScan, kFinishedScanning])
    assert run_scan(scoord, kind) is True
    scanner = shost.fScanners.One(kind)
    shost.fLocCache.fAnswers[A] = False
    shost.fLog.clear()
    assert run_scan(scoord, kind) is False
    assert active(scoord, kind) == {key: scanner}
    assert len(scanner.fScans) == 1 and scanner.fDestroyCount == 0
    assert shost.fLog.names() == [('loc_cache', 'WantDerivedInfo')]


def test_whole_file_secondary_scanner_must_be_a_scanner(scoord, shost, monkeypatch):
    from pysource import scopescanner

    class NotAScanner:
        def __init__(self, *args):
            self.fArgs = args

        def Scan(self, end_time):
            return kFinishedScanning

    monkeypatch.setattr(scopescanner, 'CWholeFileSecondaryScanner', NotAScanner)
    with pytest.raises(TypeError):
        run_scan(scoord, SECONDARY_WHOLE)


def test_single_scope_secondary_scan_looks_up_its_information_every_time(scoord, shost):
    shost.fScanners.Script(SECONDARY_SCOPE, (A, 'C.m'), [kReadyToScan, kFinishedScanning])
    assert run_scan(scoord, SECONDARY_SCOPE) is True
    scanner = shost.fScanners.One(SECONDARY_SCOPE)
    shost.fInfoCache.fScopeInfos[(A, 'C.m')] = None
    assert run_scan(scoord, SECONDARY_SCOPE) is False
    assert active(scoord, SECONDARY_SCOPE) == {(A, 'C.m'): scanner}
    assert len(scanner.fScans) == 1

    shost.fInfoCache.fScopeInfos[(A, 'C.m')] = FakeScopeInfo(A, 'C.m')
    assert run_scan(scoord, SECONDARY_SCOPE) is False
    assert shost.fScanners.Made() == [scanner]
    assert len(shost.fLog.find('info_cache', 'GetScopeInfo')) == 3
    assert active(scoord, SECONDARY_SCOPE) == {}
    assert scoord.fLog.fCalls == []  # single-scope secondary scans log nothing
    assert queued(scoord) == {}


def test_single_scope_secondary_scan_without_information(scoord, shost):
    shost.fInfoCache.fScopeInfos[(A, 'C.m')] = None
    assert run_scan(scoord, SECONDARY_SCOPE) is False
    assert shost.fScanners.Made() == []


# ---- reference cycles ------------------------------------------------------------------------

@pytest.mark.parametrize('cls', [scancoordinator.CScanCoordinator, ScanCountingCoordinator],
                         ids=['class', 'counting-subclass'])
def test_coordinator_with_waiting_and_unfinished_scanners_is_freed(cls, host_reset,
                                                                   monkeypatch):
    h = ScanHost().Install().Patch(monkeypatch)
    c = make_coord(cls, h)
    h.fAnaMgr.fScanCoordinator = c
    # coordinator -> active scanners -> their "scan-state-changed" handler -> coordinator
    h.fScanners.Script(PRIMARY_WHOLE, A, [kWaitingForData])
    h.fScanners.Script(SECONDARY_SCOPE, (B, 'f'), [kReadyToScan])
    queue_item(c, CScanItem(A, '*', PRIMARY, 1))
    c._CB_DoIdleAnalysis()
    assert c._CScanCoordinator__DoSecondarySingleScopeScan(B, 'f', time.time() + 5) is True
    waiting_scanner = weakref.ref(h.fScanners.One(PRIMARY_WHOLE, A))
    other_scanner = weakref.ref(h.fScanners.One(SECONDARY_SCOPE))
    ref = weakref.ref(c)

    c.destroy()
    h.Destroy()
    del h.fScanners.fCreated[:]
    singleton.ResetSingletons()
    ostrelgtk.reset()
    del c, h
    gc.collect()
    assert ref() is None
    assert waiting_scanner() is None and other_scanner() is None
