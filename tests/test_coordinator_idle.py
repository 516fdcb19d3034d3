"""CScanCoordinator: the idle analysis loop.

Covers a file's whole way from being reported parseable to the database write,
run by the main loop; the slice's time budget; what a slice returns and emits;
quitting and waiting for remote modules; the whole-file check against
modification times and recorded scans; the recent-scan and non-Python skips;
completion bookkeeping; secondary scans without a builtins module; the
exception path (also under `python -O`) and recovery after a failure; logging.

Tests that take `scoord` run on the class and on ScanCountingCoordinator (see
scan_doubles); on the latter they also check the calls the loop made to the
coordinator's own overridable operations.
"""
import time

import pytest
from coord_doubles import *
from coord_doubles import (
    DERIVED,
    PRIMARY,
    Boom,
    GtkSpy,
    analysis_idles,
    kBackgroundPriority,
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
    ScanAnalysis,
    ScanCountingCoordinator,
    active,
    data_waiting,
    is_counting,
    kFinishedScanning,
    kReadyToScan,
    kTimedOut,
    kWaitingForData,
    pending_callbacks,
    run_optimised,
    take_over_idle,
    timed_slice,
)

from pysource import inferenceengine, scancoordinator, utils

CScanItem = scancoordinator.CScanItem

A = local('a.py')
B = local('b.py')
C = local('c.py')

kEntering = 'Entering _CB_DoIdleAnalysis()'
kQuittingMsg = 'Returning False from _CB_DoIdleAnalysis because Ostrel in quitting'
kEmptyMsg = ('Returning False from _CB_DoIdleAnalysis() because scan queue is empty'
             ' (not including waiting)')
kNotEmptyMsg = 'Returning True from _CB_DoIdleAnalysis() because scan queue is not empty'
kExceptionMsg = 'Exception raised in _CB_DoIdleAnalysis(); implicitly returning None'
kOutOfTimeMsg = 'Out of time after whole file check'
kNoLocMsg = 'loc is None in scan_item'


def checking(whole):
    return f'Checking whole files: {whole!r}'


def scans_done(d):
    return f'__CheckWholeFiles scans_done_dict: {d!r}'


def calls_of(host, *who):
    """(who, what, args) of the calls on the given doubles, in order."""
    return [(c.who, c.what, c.args) for c in host.fLog if c.who in who]


@pytest.fixture
def spy(monkeypatch, shost):
    return GtkSpy(monkeypatch, shost.fLog)


# ---- the road of one file ------------------------------------------------------------------

def test_one_file_from_parseable_to_database_write(scoord, shost, spy):
    shost.fFileAttribMgr.fMimeTypes[A] = 'text/x-python'
    record_signals(scoord, shost.fLog, 'scheduled', 'end')
    t0 = time.time()

    scoord.AddParseablesToQueue([A])
    assert queued(scoord) == {(A, '*', PRIMARY): kBackgroundPriority}
    assert len(analysis_idles(scoord)) == 1

    assert ostrelgtk.run_until_idle(100)

    primary = shost.fScanners.One(PRIMARY_WHOLE, A)
    secondary = shost.fScanners.One(SECONDARY_WHOLE, A)
    assert shost.fScanners.Made() == [primary, secondary]
    assert primary.fArgs == (A, PRIMARY)
    assert primary.fKwargs['log'] is scoord.fLog
    assert secondary.fArgs == (A, DERIVED, scoord.fLog)
    assert [s.state for s in primary.fScans + secondary.fScans] == [kFinishedScanning] * 2
    assert primary.fDestroyCount == secondary.fDestroyCount == 1

    # What the collaborators were asked, in order (the builtins module is never
    # found here, and the whole-file check finds nothing up to date).
    calls = [c for c in calls_of(shost, 'info_cache', 'loc_cache', 'factory', 'scanner')
             if (c[1] != 'FindBuiltinMod' and c[:2] != ('info_cache', 'GetAllImports'))
             or c == ('info_cache', 'GetAllImports', ([A],))]
    assert [c[:2] for c in calls if c[0] == 'scanner'] == [
        ('scanner', 'create'), ('scanner', 'Scan'), ('scanner', 'destroy')] * 2
    assert [c for c in calls if c[0] != 'scanner'] == [
        ('info_cache', 'GetDiskMTime', (A,)),
        ('info_cache', 'GetScansDoneForMultipleFiles', ({A: 100.0},)),
        ('info_cache', 'GetAllImports', ([A],)),
        ('factory', 'GetSecondaryLocations', (A,)),
        ('loc_cache', 'WantDerivedInfo', (A,)),
        ('info_cache', 'FinishedWithScans', (A, '*', PRIMARY)),
        ('info_cache', 'Trim', ()),
        ('loc_cache', 'GetBuiltinLoc', ()),
        ('loc_cache', 'WantDerivedInfo', (A,)),
        ('info_cache', 'FinishedWithScans', (A, '*', DERIVED)),
        ('info_cache', 'Trim', ()),
        ('info_cache', 'WriteToDatabase', ()),
    ]

    # The second slice is the one "locations-added" asked for, after the queue
    # had already run dry.
    assert scoord.fLog.Messages() == [
        kEntering,
        checking([(A, 2)]),
        scans_done({A: ''}),
        f'Starting primary whole file scan: {A!r}',
        f'Finished primary whole file scan: {A!r}',
        f'Starting secondary whole file scan: {A!r}',
        f'Finished secondary whole file scan: {A!r}',
        kNoLocMsg,
        kEmptyMsg,
        kEntering,
        kNoLocMsg,
        kEmptyMsg,
    ]
    assert [c.what for c in shost.fLog.find('signal')] == ['scheduled', 'end', 'scheduled', 'end']

    done = scoord._fLastScanCompleted
    assert set(done) == {A} and set(done[A]) == {('*', PRIMARY), ('*', DERIVED)}
    assert t0 <= done[A][('*', PRIMARY)] <= primary.fScans[0].called_at
    assert done[A][('*', PRIMARY)] <= done[A][('*', DERIVED)] <= secondary.fScans[0].called_at
    assert dict(scoord._fScanTripleCompletedCount) == {(A, '*', PRIMARY): 1,
                                                        (A, '*', DERIVED): 1}
    assert scoord._CScanCoordinator__fCompletedLocs == {A}
    assert scoord._fMTimeAtLastWholeFileCheck == {A: 100.0}
    assert A not in scoord._fIncompleteScansByLoc
    assert queued(scoord) == {} and scoord.QueuesEmpty()
    assert all(active(scoord, kind) == {} for kind in (PRIMARY_WHOLE, SECONDARY_WHOLE))
    assert scoord.fActiveScanItem is None
    assert scoord._fIdleProcId is None and analysis_idles(scoord) == []
    assert scoord._fIdleToWriteToDatabase is None
    assert scoord._fActiveIdleStart == -1.0
    # The status timeout was installed by the first slice and is still running.
    assert ostrelgtk.GetMainLoop().has_source(scoord._CScanCoordinator__fStatusTimeout)

    if is_counting(scoord):
        item_p, item_s = CScanItem(A, '*', PRIMARY, 2), CScanItem(A, '*', DERIVED, 2)
        assert [c[0] for c in scoord.Called('_DoSingleScan')] == [item_p, item_s]
        assert [c[0] for c in scoord.Called('__DoPrimaryWholeFileScan')] == [item_p]
        assert [c[0] for c in scoord.Called('__DoSecondaryWholeFileScan')] == [item_s]
        assert scoord.Called('__GetModtimeDict') == [([A],)]
        assert scoord.Called('AddPairsToSecondaryQueue') == [([(A, '*')], True, 2)]
        assert scoord.Called('_ScheduleWriteToDatabaseIdle') == [(), ()]
        assert scoord.Called('_CB_WriteToDatabase') == [()]
        assert len(scoord.Called('_CB_DoIdleAnalysis')) == 2


# ---- the slice's budget -----------------------------------------------------------------

def first_scan_budget(coord, host):
    """Queue one whole file, run one slice; the scanner's deadline minus the slice's
    start, as an interval (the slice starts between the two times taken)."""
    coord.AddPairsToPrimaryQueue([(A, '*')])
    _result, t0, t1 = timed_slice(coord)
    end_time = host.fScanners.One(PRIMARY_WHOLE, A).fScans[0].end_time
    return end_time - t1, end_time - t0


@pytest.mark.parametrize('engine_file, budget', [
    ('/opt/app/pysource/inferenceengine.py', 0.1),
    ('/opt/app/pysource/inferenceengine.pyc', 0.1),
    ('/opt/app/pysource/inferenceengine.cpython-311-x86_64-linux-gnu.so', 0.05),
    ('C:\\app\\pysource\\inferenceengine.cp311-win_amd64.pyd', 0.05),
])
def test_slice_budget_depends_on_a_compiled_inference_engine(scoord, shost, monkeypatch,
                                                             engine_file, budget):
    monkeypatch.setattr(inferenceengine, '__file__', engine_file)
    low, high = first_scan_budget(scoord, shost)
    assert low - 1e-3 <= budget <= high + 1e-3, (low, high)
    if is_counting(scoord):
        [(end_time,)] = scoord.Called('__DoScans')
        assert end_time == shost.fScanners.One(PRIMARY_WHOLE, A).fScans[0].end_time


def test_optimised_interpreter_budget_and_exception_path():
    """Under -O the budget is 0.05 s even with an uncompiled inference engine, and
    an exception inside a slice is reported, logged and swallowed (None)."""
    result = run_optimised('''
        import json, time
        import pytest, singleton
        from guiutils import ostrelgtk
        from coord_doubles import Boom, local, make_coord
        from scan_doubles import (PRIMARY_WHOLE, ScanCountingCoordinator, ScanHost,
                                  kFinishedScanning)
        from pysource import inferenceengine, scancoordinator, utils

        out = {'debug': __debug__, 'engine': inferenceengine.__file__}
        for cls in (scancoordinator.CScanCoordinator, ScanCountingCoordinator):
            ostrelgtk.reset()
            singleton.ResetSingletons()
            with pytest.MonkeyPatch.context() as mp:
                host = ScanHost().Install().Patch(mp)
                coord = make_coord(cls, host)
                a, b = local('a.py'), local('b.py')
                host.fScanners.Script(PRIMARY_WHOLE, b, [Boom('scan failed'),
                                                         kFinishedScanning])
                coord.AddPairsToPrimaryQueue([(a, '*')], priority=0)
                coord.AddPairsToPrimaryQueue([(b, '*')], priority=1)
                scheduled = coord._fIdleProcId is not None
                t0 = time.time()
                first = coord._CB_DoIdleAnalysis()
                t1 = time.time()
                end_time = host.fScanners.One(PRIMARY_WHOLE, a).fScans[0].end_time
                res = {
                    'budget': [end_time - t1, end_time - t0],
                    'result': repr(first),
                    'idle_cleared': coord._fIdleProcId is None,
                    'was_scheduled': scheduled,
                    'reports': [repr(e) for e in host.Reports()],
                    'last_message': coord.fLog.Messages()[-1],
                    'b_still_queued': coord.LocationInPrimaryScanQueue(b),
                }
                coord._ScheduleIdle()
                ostrelgtk.run_until_idle(100)
                res['recovered'] = (coord.QueuesEmpty()
                                    and len(host.fScanners.Made(PRIMARY_WHOLE, b)) == 1)
                out[cls.__name__] = res
                coord.destroy()
                host.Destroy()
        print(json.dumps(out))
    ''')
    assert result['debug'] is False and result['engine'].endswith('.py')
    for name in ('CScanCoordinator', 'ScanCountingCoordinator'):
        res = result[name]
        low, high = res['budget']
        assert low - 1e-3 <= 0.05 <= high + 1e-3, res
        # a finishes, b raises in the same slice.
        assert res['result'] == 'None', res
        assert res['was_scheduled'] and res['idle_cleared'], res
        assert res['reports'] == ["Boom('scan failed')"], res
        assert res['last_message'] == kExceptionMsg, res
        assert res['b_still_queued'] and res['recovered'], res


# ---- what a slice returns --------------------------------------------------------------

def test_slices_return_true_while_a_scan_goes_on(scoord, shost):
    shost.fScanners.Script(PRIMARY_WHOLE, A, [kReadyToScan, kTimedOut, kFinishedScanning])
    record_signals(scoord, shost.fLog, 'end')
    scoord.AddPairsToPrimaryQueue([(A, '*')])
    sid = scoord._fIdleProcId
    assert sid is not None

    assert scoord._CB_DoIdleAnalysis() is True
    assert scoord._CB_DoIdleAnalysis() is True
    assert scoord._fIdleProcId == sid  # the idle stays installed
    assert shost.fLog.find('signal') == []
    scanner = shost.fScanners.One(PRIMARY_WHOLE, A)
    assert active(scoord, PRIMARY_WHOLE) == {A: scanner}
    assert queued(scoord) == {(A, '*', PRIMARY): 1}

    assert scoord._CB_DoIdleAnalysis() is False
    assert scoord._fIdleProcId is None
    assert [c.what for c in shost.fLog.find('signal')] == ['end']
    assert shost.fScanners.Made(PRIMARY_WHOLE) == [scanner]
    assert len(scanner.fScans) == 3
    ends = [s.end_time for s in scanner.fScans]
    assert ends == sorted(set(ends))  # one deadline per slice
    assert scoord.fLog.Messages() == [
        kEntering, checking([(A, 1)]), scans_done({A: ''}),
        f'Starting primary whole file scan: {A!r}', kNotEmptyMsg,
        kEntering, kNotEmptyMsg,
        kEntering, f'Finished primary whole file scan: {A!r}',
        f'Starting secondary whole file scan: {A!r}',
        f'Finished secondary whole file scan: {A!r}', kNoLocMsg, kEmptyMsg]


def test_waiting_items_end_the_idle_without_end_signal(scoord, shost):
    shost.fScanners.Script(PRIMARY_WHOLE, A, [kWaitingForData, kFinishedScanning])
    record_signals(scoord, shost.fLog, 'end')
    scoord.AddPairsToPrimaryQueue([(A, '*')])

    assert scoord._CB_DoIdleAnalysis() is False
    assert scoord._fIdleProcId is None
    assert data_waiting(scoord) == {(A, '*', PRIMARY, 1)}
    assert shost.fLog.find('signal') == []
    assert scoord._fActiveIdleStart >= 0  # the run of slices is not over
    assert scoord._fIdleToWriteToDatabase is not None
    assert scoord.fLog.Messages()[-1] == kEmptyMsg


def test_empty_queue_ends_schedule_one_database_write(scoord, shost, spy):
    record_signals(scoord, shost.fLog, 'end')
    assert scoord._CB_DoIdleAnalysis() is False
    assert scoord._CB_DoIdleAnalysis() is False
    assert [c.what for c in shost.fLog.find('signal')] == ['end', 'end']
    assert len(pending_callbacks(scoord, '_CB_WriteToDatabase')) == 1
    assert ostrelgtk.run_until_idle(10)
    assert len(shost.fLog.find('info_cache', 'WriteToDatabase')) == 1
    assert scoord.fLog.Messages() == [kEntering, kNoLocMsg, kEmptyMsg] * 2
    if is_counting(scoord):
        assert scoord.Called('_ScheduleWriteToDatabaseIdle') == [(), ()]
        assert scoord.Called('QueuesEmpty').count((True,)) == 2


def test_quitting_stops_the_next_slice(scoord, shost):
    scoord.AddPairsToPrimaryQueue([(A, '*')])
    sid = scoord._fIdleProcId
    scoord.Quitting()
    shost.fLog.clear()
    assert scoord._CB_DoIdleAnalysis() is False
    assert scoord.fLog.Texts() == [kEntering, kQuittingMsg]
    assert scoord._fIdleProcId == sid
    assert scoord._CScanCoordinator__fStatusTimeout is None
    assert shost.fLog == []
    assert queued(scoord) == {(A, '*', PRIMARY): 1}
    if is_counting(scoord):
        assert scoord.Called('__DoScans') == []
        assert scoord.Called('_ScheduleWriteToDatabaseIdle') == []


def test_waiting_for_remote_modules_does_no_work(scoord, shost):
    scoord.AddPairsToPrimaryQueue([(A, '*')])
    shost.fModFileCache.emit('suspend')
    shost.fLog.clear()
    assert scoord._CB_DoIdleAnalysis() is True
    assert scoord.fLog.Messages() == [kEntering, kNotEmptyMsg]
    assert shost.fLog.find('info_cache') == [] and shost.fScanners.Made() == []
    assert shost.fLog.find('factory') == []  # not even the builtins module

    shost.fModFileCache.emit('unsuspend')
    assert scoord._CB_DoIdleAnalysis() is False
    assert len(shost.fScanners.Made(PRIMARY_WHOLE, A)) == 1


# ---- the builtins and typing modules ------------------------------------------------------

def test_basic_modules_are_queued_by_the_first_slice_that_finds_them(scoord, shost):
    builtins = local('stubs/builtins.pyi')
    scoord.AddPairsToPrimaryQueue([(A, '*')], priority=2)
    shost.fFactory.fBuiltinMod = None
    scoord._CB_DoIdleAnalysis()
    assert not scoord._fAllBasicModuleQueued

    shost.fFactory.SetBuiltins('builtins', [builtins])
    scoord.AddPairsToPrimaryQueue([(B, '*')], priority=2)
    scoord._CB_DoIdleAnalysis()
    assert scoord._fAllBasicModuleQueued
    # Queued at priority 0 and scanned in the same slice, before B.
    made = [s.fKey for s in shost.fScanners.Made(PRIMARY_WHOLE)]
    assert made == [A, builtins, B]
    finds = len(shost.fLog.find('factory', 'FindBuiltinMod'))
    scoord._CB_DoIdleAnalysis()
    assert len(shost.fLog.find('factory', 'FindBuiltinMod')) == finds
    if is_counting(scoord):
        assert len(scoord.Called('_QueueBasicModules')) == 2


def test_basic_modules_that_report_true_end_the_slice(shost):
    class EarlyCoordinator(ScanCountingCoordinator):
        def _QueueBasicModules(self, end_time):
            super()._QueueBasicModules(end_time)
            return True

    coord = make_coord(EarlyCoordinator, shost)
    coord.AddPairsToPrimaryQueue([(A, '*')])
    assert coord._CB_DoIdleAnalysis() is True
    assert coord.Called('__CheckWholeFiles') == []
    assert shost.fLog.find('info_cache') == [] and shost.fScanners.Made() == []
    coord.destroy()


# ---- the whole-file check ---------------------------------------------------------------

def test_whole_file_check(scoord, shost):
    fresh, both, nowant, missing, stale = (local('fresh.py'), local('both.py'),
                                           local('lib/nowant.py'), local('gone.py'),
                                           local('stale.py'))
    info = shost.fInfoCache
    info.fMTimes[missing] = 0
    info.fScansDone.update({fresh: f'x {PRIMARY} y', both: f'{DERIVED} {PRIMARY}',
                            nowant: PRIMARY, stale: DERIVED})
    info.fImports.update({fresh: [b':ios'], both: [b':fpkg name', b':ios'],
                          nowant: [b':ire']})
    shost.fLocCache.fAnswers[nowant] = False
    record_signals(scoord, shost.fLog, 'modtimes-updated')
    scoord.AddPairsToSecondaryQueue([(fresh, 'f'), (missing, 'g')], priority=1)
    scoord.AddPairsToPrimaryQueue([(fresh, '*')], priority=1)
    scoord.AddPairsToPrimaryQueue([(both, '*'), (nowant, 'C.m'), (missing, '*'),
                                   (stale, '*')], priority=2)
    shost.fLog.clear()

    assert scoord._CScanCoordinator__CheckWholeFiles(time.time() + 10) is False

    assert queued(scoord) == {(fresh, '*', DERIVED): 1, (stale, '*', PRIMARY): 2}
    assert scoord._fMTimeAtLastWholeFileCheck == {fresh: 100.0, both: 100.0, nowant: 100.0,
                                                  missing: 0, stale: 100.0}
    assert list(scoord._fScanQueue._fWholeFilesToCheck.items()) == []
    [(asked,)] = shost.fLog.args('info_cache', 'GetScansDoneForMultipleFiles')
    assert asked == {fresh: 100.0, both: 100.0, nowant: 100.0, stale: 100.0}
    # Derived information is asked about only where the derived scan is not done.
    wants = [a[0] for a in shost.fLog.args('loc_cache', 'WantDerivedInfo')]
    assert both not in wants and wants.count(nowant) == 1
    # The imports of the up-to-date files, per (directory, priority).
    [(up_to_date,)] = shost.fLog.args('info_cache', 'GetAllImports')
    assert sorted(up_to_date) == sorted([fresh, both, nowant])
    priority = {fresh: 1, both: 2, nowant: 2}
    groups = {}
    for loc in up_to_date:
        groups.setdefault((loc.GetParentDir(), priority[loc]), set()).update(info.fImports[loc])
    # The batch's times, then the (empty) times of each group's module files.
    assert [c.args for c in shost.fLog.find('signal')] == [
        (scoord._fMTimeAtLastWholeFileCheck,)] + [({},)] * len(groups)
    names_of = {b':ios': {'os'}, b':fpkg name': {'pkg.name', 'pkg'}, b':ire': {'re'}}
    assert shost.fLog.args('factory', '_FindPrimaryLocsForNames') == [
        (set().union(*(names_of[e] for e in equivs)), dirloc, False)
        for (dirloc, _prio), equivs in groups.items()]
    assert scoord.fLog.Texts()[:2] == [
        checking([(stale, 2), (missing, 2), (nowant, 2), (both, 2), (fresh, 1)]),
        scans_done({stale: DERIVED, nowant: PRIMARY, both: f'{DERIVED} {PRIMARY}',
                    fresh: f'x {PRIMARY} y'})]
    if is_counting(scoord):
        assert scoord.Called('AddPairsToSecondaryQueue')[-1:] == [([(fresh, '*')], False, 1)]
        calls = scoord.Called('__AddImportEquivsToQueue')
        assert [(dirloc, prio) for _e, dirloc, prio in calls] == list(groups)
        assert [set(e) for e, _d, _p in calls] == list(groups.values())


def test_missing_modtime_dict_ends_the_slice_through_the_exception_path(shost):
    class NoTimes(ScanCountingCoordinator):
        def _CScanCoordinator__GetModtimeDict(self, loc_seq):
            super()._CScanCoordinator__GetModtimeDict(loc_seq)

    coord = make_coord(NoTimes, shost)
    coord.AddPairsToPrimaryQueue([(A, '*')])
    with pytest.raises((TypeError, AttributeError)) as exc_info:
        coord._CB_DoIdleAnalysis()
    assert shost.Reports() == [exc_info.value]
    assert coord.fLog.Messages()[-1] == kExceptionMsg
    assert coord._fIdleProcId is None
    assert shost.fLog.find('info_cache', 'GetScansDoneForMultipleFiles') == []
    assert shost.fScanners.Made() == []
    coord.destroy()


@pytest.mark.parametrize('answer', [None, ['not', 'a', 'dict']])
def test_scans_done_of_the_wrong_type_ends_the_slice_through_the_exception_path(
        scoord, shost, answer):
    shost.fInfoCache.fScansDoneResult = answer
    scoord.AddPairsToPrimaryQueue([(A, '*')])
    with pytest.raises((TypeError, AttributeError)) as exc_info:
        scoord._CB_DoIdleAnalysis()
    assert shost.Reports() == [exc_info.value]
    assert scoord.fLog.Messages()[-2:] == [scans_done(answer), kExceptionMsg]
    assert scoord._fIdleProcId is None
    assert shost.fScanners.Made() == []


def test_the_check_gives_up_after_a_batch_once_out_of_time(scoord, shost):
    locs = [local(f'm{i:02}.py') for i in range(30)]
    scoord.AddPairsToPrimaryQueue([(loc, '*') for loc in locs], priority=2)
    end_time = time.time() + 0.01

    def wait_for_deadline(loc):
        while time.time() <= end_time:
            time.sleep(0.001)

    shost.fInfoCache.Probe('GetDiskMTime', wait_for_deadline)
    shost.fLog.clear()
    assert scoord._CScanCoordinator__DoScans(end_time) is None
    assert len(shost.fLog.find('info_cache', 'GetDiskMTime')) == 26
    assert len(scoord._fScanQueue._fWholeFilesToCheck) == 4
    assert scoord.fLog.Messages()[-1] == kOutOfTimeMsg
    assert shost.fScanners.Made() == []


def test_a_slice_past_its_deadline_does_nothing_but_look_for_basic_modules(scoord, shost):
    scoord.AddPairsToPrimaryQueue([(A, '*')])
    shost.fLog.clear()
    scoord._CScanCoordinator__DoScans(time.time() - 1.0)
    assert shost.fLog.names() == [('factory', 'FindBuiltinMod')]
    assert scoord.fLog.Messages() == []
    assert queued(scoord) == {(A, '*', PRIMARY): 1}


# ---- skipping and dropping scans --------------------------------------------------------

@pytest.mark.parametrize('age, skipped', [(4.9, True), (5.1, False)])
def test_recently_completed_scans_are_not_run_again(scoord, shost, age, skipped):
    scoord.AddPairsToPrimaryQueue([(A, 'f')], priority=1)
    scoord.AddPairsToPrimaryQueue([(B, 'g')], priority=2)
    t = time.time() - age
    scoord._fLastScanCompleted[A] = {('f', PRIMARY): t, ('g', PRIMARY): time.time()}

    result = scoord._CB_DoIdleAnalysis()

    made = [s.fKey for s in shost.fScanners.Made(PRIMARY_SCOPE)]
    if skipped:
        # Taken out of the queue, and the slice ends there.
        assert result is True
        assert made == []
        assert queued(scoord) == {(B, 'g', PRIMARY): 2}
        assert f'Skipping scan because last scan is too recent: {(A, "f", PRIMARY)!r}' in \
            scoord.fLog.Messages()
        assert scoord._fLastScanCompleted[A][('f', PRIMARY)] == t
        assert shost.fLog.find('info_cache', 'FinishedWithScans') == []
    else:
        assert made == [(A, 'f'), (B, 'g')]
        assert scoord._fLastScanCompleted[A][('f', PRIMARY)] > t + age - 1
        assert not any(m.startswith('Skipping') for m in scoord.fLog.Messages())


@pytest.mark.parametrize('name, is_python, asked', [
    ('stub.pyi', True, []),
    ('stub.pi', True, []),
    ('tool', True, ['IsPythonSource']),
    ('page.html', True, ['IsPythonSource', 'GetAnalysis']),
    ('notes.txt', False, ['IsPythonSource', 'GetAnalysis']),
    ('data.bin', False, ['IsPythonSource', 'GetAnalysis']),
])
def test_python_check(scoord, shost, monkeypatch, name, is_python, asked):
    loc = local(name)
    if name == 'page.html':
        shost.fCacheMgr.fAnalyses[loc] = ScanAnalysis(loc, shost.fLog)
    if name == 'data.bin':
        shost.fCacheMgr.fAnalyses[loc] = object()  # not a source analysis

    def is_python_source(arg):
        shost.fLog.add('utils', 'IsPythonSource', arg)
        return arg == local('tool')

    monkeypatch.setattr(utils, 'IsPythonSource', is_python_source)
    shost.fLocCache.fAnswers[loc] = False  # no secondary scan to check as well
    scoord.AddPairsToPrimaryQueue([(loc, 'f')], priority=0)
    scoord.AddPairsToPrimaryQueue([(B, 'g')], priority=1)
    shost.fLog.clear()

    assert scoord._CB_DoIdleAnalysis() is False
    made = [s.fKey for s in shost.fScanners.Made(PRIMARY_SCOPE)]
    assert made == ([(loc, 'f')] if is_python else []) + [(B, 'g')]
    # (The scan itself looks for an existing analysis, without creating one.)
    assert [c.what for c in shost.fLog if c.args and c.args[0] == loc and (
        c.what == 'IsPythonSource' or (c.what == 'GetAnalysis' and c.args[1]))] == asked
    if 'GetAnalysis' in asked:
        assert shost.fLog.args('cache_mgr', 'GetAnalysis')[0] == (loc, True)
    removed = f'Removing scan because not python: {(loc, "f", PRIMARY)!r}'
    assert (removed in scoord.fLog.Messages()) is not is_python
    assert queued(scoord) == {}
    assert (loc in scoord._fLastScanCompleted) is is_python
    if is_counting(scoord) and 'GetAnalysis' in asked:
        assert scoord.Called('__GetAnalysis')[0] == (loc, True)


def test_location_being_scanned_counts_as_python(scoord, shost, monkeypatch):
    page = local('page.html')
    shost.fCacheMgr.fAnalyses[page] = ScanAnalysis(page, shost.fLog)
    shost.fScanners.Script(PRIMARY_WHOLE, page, [kReadyToScan, kFinishedScanning])
    shost.fLocCache.fAnswers[page] = False  # no secondary scan of it to check afterwards
    asked = []
    monkeypatch.setattr(utils, 'IsPythonSource', lambda loc: asked.append(loc) and False)
    scoord.AddPairsToPrimaryQueue([(page, '*')], priority=1)
    assert scoord._CB_DoIdleAnalysis() is True
    assert scoord._CScanCoordinator__fActiveLoc == page
    assert asked == [page]
    # The next slice resumes the same location without asking again.
    scoord._CB_DoIdleAnalysis()
    assert asked == [page]
    assert shost.fLog.args('cache_mgr', 'GetAnalysis') == [(page, True)]
    assert len(shost.fScanners.One(PRIMARY_WHOLE, page).fScans) == 2
    assert scoord._CScanCoordinator__fActiveLoc is None


def test_get_analysis_answers_only_source_analyses(scoord, shost):
    ana = ScanAnalysis(A, shost.fLog)
    shost.fCacheMgr.fAnalyses.update({A: ana, B: 'an analysis of another kind'})
    get = scoord._CScanCoordinator__GetAnalysis
    assert get(A, False) is ana
    assert get(B, True) is None
    assert get(C, True) is None
    assert shost.fLog.args('cache_mgr', 'GetAnalysis') == [(A, False), (B, True), (C, True)]


def test_secondary_scans_without_builtins_count_as_done(scoord, shost):
    shost.fLocCache.fBuiltinLoc = None
    scoord.AddPairsToSecondaryQueue([(A, '*'), (B, 'f')], priority=1)
    t0 = time.time()
    assert scoord._CB_DoIdleAnalysis() is False
    assert shost.fScanners.Made() == []
    assert queued(scoord) == {}
    done = scoord._fLastScanCompleted
    assert set(done) == {A, B}
    assert set(done[A]) == {('*', DERIVED)} and set(done[B]) == {('f', DERIVED)}
    assert t0 <= done[A][('*', DERIVED)] <= done[B][('f', DERIVED)] <= time.time()
    assert scoord._CScanCoordinator__fCompletedLocs == {A, B}
    assert len(shost.fLog.find('info_cache', 'Trim')) == 2
    # Nothing ran, so nothing is reported finished or counted.
    assert shost.fLog.find('info_cache', 'FinishedWithScans') == []
    assert dict(scoord._fScanTripleCompletedCount) == {}
    if is_counting(scoord):
        assert len(scoord.Called('_DoSingleScan')) == 2
        assert scoord.Called('__DoSecondaryWholeFileScan') == []
        assert scoord.Called('__DoSecondarySingleScopeScan') == []


# ---- one scan ----------------------------------------------------------------------------

def test_do_single_scan_dispatch_and_bookkeeping(scoord, shost):
    seen = []

    def probe(scanner, end_time):
        seen.append(scoord.fActiveScanItem)
        return kFinishedScanning

    items = [CScanItem(A, '*', PRIMARY, 1), CScanItem(A, 'f', PRIMARY, 1),
             CScanItem(B, '*', DERIVED, 2), CScanItem(B, 'g', DERIVED, 2),
             CScanItem(C, '*', 'other-scan', 0)]
    for kind, key in [(PRIMARY_WHOLE, A), (PRIMARY_SCOPE, (A, 'f')), (SECONDARY_WHOLE, B),
                      (SECONDARY_SCOPE, (B, 'g')), (SECONDARY_WHOLE, C)]:
        shost.fScanners.Script(kind, key, [probe])
    end_time = time.time() + 5
    for item in items:
        assert scoord._DoSingleScan(item, end_time) is False
        assert scoord.fActiveScanItem is None
    assert seen == items
    assert [(s.kKind, s.fKey) for s in shost.fScanners.Made()] == [
        (PRIMARY_WHOLE, A), (PRIMARY_SCOPE, (A, 'f')), (SECONDARY_WHOLE, B),
        (SECONDARY_SCOPE, (B, 'g')), (SECONDARY_WHOLE, C)]
    assert shost.fScanners.Made()[-1].fArgs == (C, 'other-scan', scoord.fLog)
    assert all(s.fScans[0].end_time == end_time for s in shost.fScanners.Made())
    assert shost.fLog.args('info_cache', 'FinishedWithScans') == [tuple(i[:3]) for i in items]
    assert dict(scoord._fScanTripleCompletedCount) == {tuple(i[:3]): 1 for i in items}
    assert scoord._DoSingleScan(items[0], end_time) is False
    assert scoord._fScanTripleCompletedCount[(A, '*', PRIMARY)] == 2


def test_do_single_scan_unfinished_or_failing(scoord, shost):
    item = CScanItem(A, 'f', PRIMARY, 1)
    shost.fScanners.Script(PRIMARY_SCOPE, (A, 'f'), [kReadyToScan, Boom('bad'),
                                                      kFinishedScanning])
    end_time = time.time() + 5
    assert scoord._DoSingleScan(item, end_time) is True
    assert scoord.fActiveScanItem is None
    with pytest.raises(Boom):
        scoord._DoSingleScan(item, end_time)
    assert scoord.fActiveScanItem is None
    assert shost.fLog.find('info_cache', 'FinishedWithScans') == []
    assert dict(scoord._fScanTripleCompletedCount) == {}
    assert scoord._DoSingleScan(item, end_time) is False
    assert len(shost.fScanners.Made()) == 1


# ---- failures and recovery -----------------------------------------------------------------

def test_a_failing_scanner_is_reported_reraised_and_resumed(scoord, shost):
    shost.fScanners.Script(PRIMARY_WHOLE, A, [kReadyToScan, Boom('scan failed'),
                                              kFinishedScanning])
    scoord.AddPairsToPrimaryQueue([(A, '*')])
    take_over_idle(scoord)
    assert scoord._CB_DoIdleAnalysis() is True
    with pytest.raises(Boom) as exc_info:
        scoord._CB_DoIdleAnalysis()
    assert shost.Reports() == [exc_info.value]
    assert scoord.fLog.Messages()[-2:] == [kEntering, kExceptionMsg]
    assert scoord._fIdleProcId is None
    assert scoord.fActiveScanItem is None
    scanner = shost.fScanners.One(PRIMARY_WHOLE, A)
    assert active(scoord, PRIMARY_WHOLE) == {A: scanner}
    assert queued(scoord) == {(A, '*', PRIMARY): 1}

    scoord._ScheduleIdle()
    assert len(analysis_idles(scoord)) == 1
    assert ostrelgtk.run_until_idle(100)
    assert shost.fScanners.Made(PRIMARY_WHOLE) == [scanner]
    assert len(scanner.fScans) == 3
    assert scoord.fLog.Messages().count(f'Starting primary whole file scan: {A!r}') == 1
    assert scoord.QueuesEmpty()
    assert len(shost.fScanners.Made(SECONDARY_WHOLE, A)) == 1


def test_a_failing_collaborator_leaves_the_work_queued(scoord, shost):
    scoord.AddPairsToPrimaryQueue([(A, '*')])
    take_over_idle(scoord)
    shost.fInfoCache.Fail('GetDiskMTime', Boom('disk gone'))
    with pytest.raises(Boom):
        scoord._CB_DoIdleAnalysis()
    assert queued(scoord) == {(A, '*', PRIMARY): 1}
    assert scoord._fIdleProcId is None

    shost.fInfoCache.Fail('GetDiskMTime', None)
    scoord._ScheduleIdle()
    assert ostrelgtk.run_until_idle(100)
    assert scoord.QueuesEmpty()
    assert [s.fKey for s in shost.fScanners.Made()] == [A, A]


def test_the_main_loop_sees_the_reraised_exception(scoord, shost):
    shost.fScanners.Script(PRIMARY_WHOLE, A, [Boom('scan failed'), kFinishedScanning])
    record_signals(scoord, shost.fLog, 'scheduled')
    scoord.AddPairsToPrimaryQueue([(A, '*')])
    sid = scoord._fIdleProcId
    assert ostrelgtk.iteration()
    # Reported by the coordinator, then by the main loop that got it re-raised.
    reports = shost.Reports()
    assert len(reports) == 2 and reports[0] is reports[1]
    assert isinstance(reports[0], Boom)
    assert not ostrelgtk.GetMainLoop().has_source(sid)
    assert scoord._fIdleProcId is None
    # The queue's "locations-added" asks for the idle again, which finishes the scan.
    assert ostrelgtk.run_until_idle(100)
    assert [c.what for c in shost.fLog.find('signal')] == ['scheduled', 'scheduled']
    assert scoord.QueuesEmpty() and len(shost.Reports()) == 2


# ---- logging and the run of slices ----------------------------------------------------------

def test_queue_listing_only_when_logging_is_on(scoord, shost):
    scoord.AddPairsToPrimaryQueue([(A, '*')])
    scoord._CB_DoIdleAnalysis()
    texts = scoord.fLog.Texts()
    assert texts.index(kEmptyMsg) < texts.index('_CScanQueue contents:\n')

    scoord.fLog.Clear()
    scoord.fLog.fOutputFile = None
    scoord.AddPairsToPrimaryQueue([(B, '*')])
    scoord._CB_DoIdleAnalysis()
    assert scoord.fLog.DumpLines() == []
    assert scoord.fLog.Texts()[-1] == kEmptyMsg


def test_start_of_a_run_of_slices(scoord, shost):
    shost.fScanners.Script(PRIMARY_WHOLE, A, [kReadyToScan, kReadyToScan, kFinishedScanning])
    assert scoord._fActiveIdleStart == -1.0 and scoord._fLastLogQueue == -1.0
    scoord.AddPairsToPrimaryQueue([(A, '*')])
    _result, t0, t1 = timed_slice(scoord)
    start = scoord._fActiveIdleStart
    assert t0 <= start <= t1
    assert scoord._fLastLogQueue == start
    scoord._CB_DoIdleAnalysis()
    assert scoord._fActiveIdleStart == start and scoord._fLastLogQueue == start
    assert scoord.fLog.DumpLines() == []  # no listing within two seconds
    scoord._CB_DoIdleAnalysis()
    assert scoord._fActiveIdleStart == -1.0
    assert scoord._fLastLogQueue == start


# ---- overrides -------------------------------------------------------------------------

def test_overridden_single_scan_decides_for_the_loop(shost):
    class Holding(ScanCountingCoordinator):
        def _DoSingleScan(self, scan_item, end_time):
            self.fCalls.append(('_DoSingleScan', scan_item, end_time))
            return True

    coord = make_coord(Holding, shost)
    coord.AddPairsToPrimaryQueue([(A, '*')])
    assert coord._CB_DoIdleAnalysis() is True
    assert [c[0] for c in coord.Called('_DoSingleScan')] == [CScanItem(A, '*', PRIMARY, 1)]
    assert shost.fScanners.Made() == []
    assert queued(coord) == {(A, '*', PRIMARY): 1}
    assert coord._fLastScanCompleted == {}
    coord.destroy()
