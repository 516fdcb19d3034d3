"""CScanCoordinator: the four scan methods.  The scanner each creates and its
arguments, one scanner over several slices, waiting for data, the follow-up work
of finished and abandoned scans (imports, secondary locations, secondary scans,
instance scopes), the incomplete-scope sets, and scanners that raise."""
from types import SimpleNamespace

import pytest
from coord_doubles import *

from pysource import logicalline, scopescanner

A, B, PKG = local('pkg/a.py'), local('pkg/b.py'), local('pkg')
kKinds = [PRIMARY_WHOLE, PRIMARY_SCOPE, SECONDARY_WHOLE, SECONDARY_SCOPE]
kItems = {PRIMARY_WHOLE: CScanItem(A, '*', PRIMARY, 1),
          PRIMARY_SCOPE: CScanItem(A, 'C.m', PRIMARY, 1),
          SECONDARY_WHOLE: CScanItem(A, '*', DERIVED, 1),
          SECONDARY_SCOPE: CScanItem(A, 'C.m', DERIVED, 1)}
kKeys = {PRIMARY_WHOLE: A, PRIMARY_SCOPE: (A, 'C.m'), SECONDARY_WHOLE: A,
         SECONDARY_SCOPE: (A, 'C.m')}


def run_scan(coord, kind, end_time=None, item=None):
    item = item or kItems[kind]
    end_time = end_in() if end_time is None else end_time
    names = ['PrimaryWholeFile', 'PrimarySingleScope', 'SecondaryWholeFile', 'SecondarySingleScope']
    method = getattr(coord, f'_CScanCoordinator__Do{names[kKinds.index(kind)]}Scan')
    if kind == SECONDARY_SCOPE:
        return method(item.loc, item.scope_name, end_time)
    return method(item, end_time)


def queue_item(coord, item):
    add = coord.AddPairsToPrimaryQueue if item.scan_name == PRIMARY else \
        coord.AddPairsToSecondaryQueue
    add([item[:2]], priority=item.priority)


def scope_def(def_type):
    return SimpleNamespace(fType=def_type)


@pytest.mark.parametrize('kind', kKinds)
def test_one_scanner_runs_a_scan_over_several_slices(coord, host, kind):
    host.fScanners.Script(kind, kKeys[kind], [kReadyToScan, kTimedOut, Boom('scan failed'),
                                             kFinishedScanning])
    ends = [end_in(5 + i) for i in range(4)]
    assert run_scan(coord, kind, ends[0]) is True
    scanner = host.fScanners.One()
    assert run_scan(coord, kind, ends[1]) is True
    with pytest.raises(Boom):  # a raising scanner stays active and is resumed
        run_scan(coord, kind, ends[2])
    assert active(coord, kind) == {kKeys[kind]: scanner} and scanner.fDestroyCount == 0
    assert run_scan(coord, kind, ends[3]) is False
    assert host.fScanners.Made() == [scanner] and scanner.fScans == ends
    assert active(coord, kind) == {} and scanner.fDestroyCount == 1
    starts = [m for m in coord.fLog.Messages() if m.lower().startswith('starting')]
    assert len(starts) == (kind != SECONDARY_SCOPE)
    host.fScanners.Script(kind, kKeys[kind], [kScanAbandoned])
    assert run_scan(coord, kind) is False
    assert host.fScanners.Made()[-1].fDestroyCount == 1 and active(coord, kind) == {}


def test_log_messages_pass_their_values_separately(coord, host):
    for kind in kKinds:
        run_scan(coord, kind)
    assert coord.fLog.fCalls == [
        ('Starting primary whole file scan: %r', (A,)),
        ('Finished primary whole file scan: %r', (A,)),
        ('starting primary scope scan: scope=%r, file=%r', ('C.m', A)),
        ('finished primary scope scan: scope=%r, file=%r, changed=%s', ('C.m', A, True)),
        ('Starting secondary whole file scan: %r', (A,)),
        ('Finished secondary whole file scan: %r', (A,))]
    ps = host.fScanners.Made(PRIMARY_SCOPE)[0]
    assert ps.fArgs == (A, 'C.m') and ps.fKwargs == {
        'incomplete_scope_set': coord._fIncompleteScansByLoc[A], 'log': coord.fLog}


@pytest.mark.parametrize('kind', [PRIMARY_WHOLE, PRIMARY_SCOPE])
def test_a_primary_item_waits_for_its_scanners_data(coord, host, kind):
    item = kItems[kind]
    host.fScanners.Script(kind, kKeys[kind], [kWaitingForData, kFinishedScanning])
    host.fLocCache.fAnswers[A] = False  # no secondary scans to follow
    record_signals(coord, host.fLog, 'scheduled')
    queue_item(coord, item)
    take_over_idle(coord)
    assert coord._CB_DoIdleAnalysis() is False
    scanner = host.fScanners.One()
    assert queued(coord) == {} and data_waiting(coord) == {tuple(item)}
    assert scanner.Connections() == 1 and active(coord, kind) == {kKeys[kind]: scanner}
    coord._CB_DoIdleAnalysis()  # while the scanner is silent the item is not handed out
    assert len(scanner.fScans) == 1

    host.fLog.clear()
    scanner.emit('scan-state-changed', scanner)
    assert queued(coord) == {item[:3]: item.priority} and data_waiting(coord) == set()
    assert signals_of(host.fLog) == ['scheduled'] and scanner.Connections() == 0
    coord._CancelIdle()
    scanner.emit('scan-state-changed', scanner)  # no handler left: nothing happens
    assert coord._fIdleProcId is None
    assert coord._CB_DoIdleAnalysis() is False
    assert host.fScanners.Made() == [scanner] and len(scanner.fScans) == 2
    assert coord.QueuesEmpty()


@pytest.mark.parametrize('kind', [SECONDARY_WHOLE, SECONDARY_SCOPE])
def test_a_secondary_item_waiting_for_data_stays_queued(coord, host, kind):
    item = kItems[kind]
    host.fScanners.Script(kind, kKeys[kind], [kWaitingForData, kFinishedScanning])
    queue_item(coord, item)
    assert coord._CB_DoIdleAnalysis() is True
    assert queued(coord) == {item[:3]: item.priority} and data_waiting(coord) == set()
    assert coord._CB_DoIdleAnalysis() is False
    assert host.fScanners.One().Connections() == 0


def test_a_finished_whole_file_scan_queues_its_follow_up_work(coord, host):
    sec1, sec2, mod = local('pkg/a_impl.py'), local('other/a_data.py'), local('lib/os.py')
    host.fFactory.fSecondaryLocs[A] = (loc for loc in [sec1, sec2])
    host.fFactory.fModuleLocs['os'] = mod
    host.fInfoCache.fImports[A] = [b':ios', b':lint']
    assert run_scan(coord, PRIMARY_WHOLE, item=CScanItem(A, '*', PRIMARY, 0)) is False
    assert queued(coord) == {(mod, '*', PRIMARY): 0, (sec1, '*', PRIMARY): 0,
                             (sec2, '*', PRIMARY): 0, (A, '*', DERIVED): 0}
    assert host.fLog.args('factory', '_FindPrimaryLocsForNames') == [({'os'}, PKG, False)]
    assert [(c.who, c.what) for c in host.fLog if c.who in ('scanner', 'factory')
            or c.what in ('GetAllImports', 'WantDerivedInfo')] == [
        ('scanner', 'create'), ('scanner', 'Scan'), ('scanner', 'destroy'),
        ('info_cache', 'GetAllImports'), ('factory', '_FindPrimaryLocsForNames'),
        ('factory', 'GetSecondaryLocations'), ('loc_cache', 'WantDerivedInfo')]
    # Without imports the secondary scan is still queued.
    assert run_scan(coord, PRIMARY_WHOLE, item=CScanItem(B, '*', PRIMARY, 2)) is False
    assert queued(coord)[(B, '*', DERIVED)] == 2


@pytest.mark.parametrize('found, kept', [(set(), False), ({'C.m', 'f'}, True)])
def test_the_incomplete_scopes_of_a_whole_file(coord, host, found, kept):
    host.fScanners.Script(PRIMARY_WHOLE, A, [add_incomplete(found)])
    run_scan(coord, PRIMARY_WHOLE)
    scanner = host.fScanners.One()
    assert (A in coord._fIncompleteScansByLoc) is kept
    if kept:
        assert coord._fIncompleteScansByLoc[A] is scanner.fKwargs['incomplete_scope_set']


def test_an_abandoned_whole_file_scan_queues_nothing(coord, host):
    host.fScanners.Script(PRIMARY_WHOLE, A, [add_incomplete(set(), kScanAbandoned)])
    host.fInfoCache.fImports[A] = [b':ios']
    assert run_scan(coord, PRIMARY_WHOLE) is False
    assert queued(coord) == {} and A in coord._fIncompleteScansByLoc
    assert host.fLog.find('info_cache', 'GetAllImports') == []


def test_secondary_locations_come_from_the_application_analysis_manager(coord, host):
    other = Host()  # installs itself as the application's managers
    sec = local('pkg/a_impl.py')
    other.fFactory.fSecondaryLocs[A] = [sec]
    host.fFactory.fSecondaryLocs[A] = [local('wrong.py')]
    run_scan(coord, PRIMARY_WHOLE)
    assert queued(coord) == {(sec, '*', PRIMARY): 1, (A, '*', DERIVED): 1}
    other.Destroy()


def test_a_single_scope_scan_refreshes_an_existing_analysis(coord, host):
    host.fCacheMgr.fAnalyses[A] = Analysis(A, host.fLog)
    host.fCacheMgr.fAnalyses[B] = object()  # not a source analysis: ignored
    host.fScanners.Script(PRIMARY_SCOPE, (A, 'C.m'), [kReadyToScan, kFinishedScanning])
    run_scan(coord, PRIMARY_SCOPE)
    run_scan(coord, PRIMARY_SCOPE)
    run_scan(coord, PRIMARY_SCOPE, item=CScanItem(B, 'f', PRIMARY, 1))
    assert [(c.who, c.what) for c in host.fLog if c.who in ('analysis', 'scanner')][:2] == [
        ('analysis', 'UpdateFromCache'), ('scanner', 'create')]
    assert len(host.fLog.find('analysis', 'UpdateFromCache')) == 1
    assert host.fLog.args('cache_mgr', 'GetAnalysis') == [(A, False), (B, False)]


@pytest.mark.parametrize('scope, sdef, containing, instance', [
    ('C', logicalline.kClassDef, None, 'C()'),
    ('C.m', logicalline.kFunctionDef, logicalline.kClassDef, 'C()'),
    ('Outer.Inner.m', logicalline.kFunctionDef, logicalline.kClassDef, 'Outer.Inner()'),
    ('f', logicalline.kFunctionDef, None, None),
    ('', None, None, None),
])
def test_a_changed_scope_queues_its_secondary_scan_and_instance_scope(coord, host, scope, sdef,
                                                                      containing, instance):
    host.fScanners.Script(
        PRIMARY_SCOPE, (A, scope), scope_def=sdef and scope_def(sdef),
        containing_class_def=containing and scope_def(containing))
    assert coord._DoSingleScan(CScanItem(A, scope, PRIMARY, 2), end_in()) is False
    expected = {(A, scope, DERIVED): 2}
    if instance is not None:
        expected[(A, instance, PRIMARY)] = 2
    assert queued(coord) == expected
    # Unchanged, nothing is queued; abandoned, the scope is saved and followed up.
    host.fScanners.Script(PRIMARY_SCOPE, (B, 'C'), changed=False,
                          scope_def=scope_def(logicalline.kClassDef))
    host.fScanners.Script(PRIMARY_SCOPE, (B, 'D'), [kScanAbandoned],
                          scope_def=scope_def(logicalline.kClassDef))
    coord._DoSingleScan(CScanItem(B, 'C', PRIMARY, 1), end_in())
    coord._DoSingleScan(CScanItem(B, 'D', PRIMARY, 1), end_in())
    assert {k: v for k, v in queued(coord).items() if k[0] == B} == {
        (B, 'D', DERIVED): 1, (B, 'D()', PRIMARY): 1}
    assert [s.fSaves for s in host.fScanners.Made()[1:]] == [[(False,)], [(False,)]]
    assert coord.fLog.Messages()[-3] == (
        f"finished primary scope scan: scope='C', file={B!r}, changed=False")


def test_a_changed_scope_queues_its_imports(coord, host):
    mods = {'os': local('lib/os.py'), 'json': local('lib/json/__init__.py'),
            'json.decoder': local('lib/json/decoder.py')}
    host.fFactory.fModuleLocs.update(mods)
    # Equivalents come as text or as UTF-8 bytes.
    info = SimpleNamespace(type_equivs={'os': ':ios;x.y', 'loads': b':fjson.decoder loads',
                                        'data': b':lint', 'path': b'os.path;:ios'})
    host.fScanners.Script(PRIMARY_SCOPE, (A, 'f'), info=info)
    assert coord._DoSingleScan(CScanItem(A, 'f', PRIMARY, 1), end_in()) is False
    assert host.fLog.args('factory', '_FindPrimaryLocsForNames') == [
        ({'os', 'json.decoder.loads', 'json.decoder', 'json'}, PKG, False)]
    assert queued(coord) == {(A, 'f', DERIVED): 1, **{(loc, '*', PRIMARY): 1
                                                     for loc in mods.values()}}


def test_an_instance_scope_is_built_without_a_scanner(coord, host):
    host.fInfoCache.fMakeInfos = False
    assert run_scan(coord, PRIMARY_SCOPE, item=CScanItem(A, 'C()', PRIMARY, 1)) is False
    assert host.fScanners.Made() == [] and A not in coord._fIncompleteScansByLoc
    assert queued(coord) == {(A, '', PRIMARY): 1}  # the parent scope, to learn about C


@pytest.mark.parametrize('kind', [SECONDARY_WHOLE, SECONDARY_SCOPE])
def test_secondary_scans_not_wanted_leave_their_scanner_alone(coord, host, kind):
    host.fScanners.Script(kind, kKeys[kind], [kReadyToScan, kFinishedScanning])
    assert run_scan(coord, kind) is True
    scanner = host.fScanners.One()
    host.fLocCache.fAnswers[A] = False
    host.fLog.clear()
    assert run_scan(coord, kind) is False
    assert active(coord, kind) == {kKeys[kind]: scanner} and len(scanner.fScans) == 1
    assert [c.what for c in host.fLog] == ['WantDerivedInfo']


def test_the_whole_file_secondary_scanner_must_be_a_scanner(coord, host, monkeypatch):
    monkeypatch.setattr(scopescanner, 'CWholeFileSecondaryScanner', lambda *args: SimpleNamespace(
        Scan=lambda end_time: kFinishedScanning))
    with pytest.raises(TypeError):
        run_scan(coord, SECONDARY_WHOLE)


def test_a_single_scope_secondary_scan_looks_up_its_information_every_time(coord, host):
    host.fScanners.Script(SECONDARY_SCOPE, (A, 'C.m'), [kReadyToScan, kFinishedScanning])
    assert run_scan(coord, SECONDARY_SCOPE) is True
    scanner = host.fScanners.One()
    info = host.fInfoCache.fScopeInfos.pop((A, 'C.m'))
    host.fInfoCache.fMakeInfos = False
    assert run_scan(coord, SECONDARY_SCOPE) is False
    assert active(coord, SECONDARY_SCOPE) == {(A, 'C.m'): scanner} and len(scanner.fScans) == 1
    assert run_scan(coord, SECONDARY_SCOPE, item=CScanItem(B, 'f', DERIVED, 1)) is False
    host.fInfoCache.Put(info)
    assert run_scan(coord, SECONDARY_SCOPE) is False
    assert host.fScanners.Made() == [scanner] and active(coord, SECONDARY_SCOPE) == {}
    assert len(host.fLog.find('info_cache', 'GetScopeInfo')) == 4
    assert coord.fLog.fCalls == []  # single-scope secondary scans log nothing
