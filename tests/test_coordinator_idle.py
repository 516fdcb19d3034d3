"""CScanCoordinator: the idle analysis loop, from a file reported parseable to the
database write; budgets, results, messages, skips, the exception path."""
import json
import os
import subprocess
import sys
import textwrap
import time

import pytest
from coord_doubles import *
from guiutils import ostrelgtk

from pysource import analysis, inferenceengine, utils

A, B, C = local('a.py'), local('b.py'), local('c.py')

kEntering = 'Entering _CB_DoIdleAnalysis()'
kQuittingMsg = 'Returning False from _CB_DoIdleAnalysis because Ostrel in quitting'
kEmptyMsg = ('Returning False from _CB_DoIdleAnalysis() because scan queue is empty'
             ' (not including waiting)')
kNotEmptyMsg = 'Returning True from _CB_DoIdleAnalysis() because scan queue is not empty'
kExceptionMsg = 'Exception raised in _CB_DoIdleAnalysis(); implicitly returning None'
kNoLocMsg = 'loc is None in scan_item'


def checking(whole):
    return f'Checking whole files: {whole!r}'


def scans_done(d):
    return f'__CheckWholeFiles scans_done_dict: {d!r}'


def scanning(loc, kind='primary'):
    return [f'{verb} {kind} whole file scan: {loc!r}' for verb in ('Starting', 'Finished')]


def test_one_file_from_parseable_to_database_write(coord, host):
    host.fFileAttribMgr.fMimeTypes[A] = 'text/x-python'
    record_signals(coord, host.fLog, 'scheduled', 'end')
    t0 = time.time()
    coord.AddParseablesToQueue([A])
    assert ostrelgtk.run_until_idle(100)

    primary, secondary = host.fScanners.Made()
    assert (primary.kKind, secondary.kKind) == (PRIMARY_WHOLE, SECONDARY_WHOLE)
    assert primary.fArgs == (A, PRIMARY) and primary.fKwargs['log'] is coord.fLog
    assert secondary.fArgs == (A, DERIVED, coord.fLog)
    assert primary.fDestroyCount == secondary.fDestroyCount == 1
    assert [(c.who, c.what, c.args) for c in host.fLog
            if c.who in ('info_cache', 'loc_cache', 'factory') and c.what != 'FindBuiltinMod'
            and c.args != ([],)] == [
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
        ('info_cache', 'WriteToDatabase', ())]
    # The second slice is the one "locations-added" asked for, after the queue ran dry.
    assert coord.fLog.Messages() == [
        kEntering, checking([(A, 2)]), scans_done({A: ''}), *scanning(A),
        *scanning(A, 'secondary'), kNoLocMsg, kEmptyMsg, kEntering, kNoLocMsg, kEmptyMsg]
    assert signals_of(host.fLog) == ['scheduled', 'end', 'scheduled', 'end']
    done = coord._fLastScanCompleted[A]
    assert t0 <= done[('*', PRIMARY)] <= done[('*', DERIVED)] <= time.time()
    assert set(coord._fLastScanCompleted) == {A} and set(done) == {('*', PRIMARY), ('*', DERIVED)}
    assert dict(coord._fScanTripleCompletedCount) == {(A, '*', PRIMARY): 1, (A, '*', DERIVED): 1}
    assert coord._CScanCoordinator__fCompletedLocs == {A}
    assert coord._fMTimeAtLastWholeFileCheck == {A: 100.0}
    assert A not in coord._fIncompleteScansByLoc and coord.QueuesEmpty()
    assert (coord.fActiveScanItem, coord._fIdleProcId, coord._fIdleToWriteToDatabase,
            coord._fActiveIdleStart) == (None, None, None, -1.0)
    assert ostrelgtk.GetMainLoop().has_source(coord._CScanCoordinator__fStatusTimeout)


@pytest.mark.parametrize('engine_file, budget', [('/opt/pysource/inferenceengine.py', 0.1),
                                                 ('C:\\pysource\\inferenceengine.pyd', 0.05),
                                                 ('/opt/pysource/inferenceengine.so', 0.05)])
def test_the_slice_budget_depends_on_a_compiled_inference_engine(coord, host, monkeypatch,
                                                                 engine_file, budget):
    monkeypatch.setattr(inferenceengine, '__file__', engine_file)
    coord.AddPairsToPrimaryQueue([(A, '*')])
    t0 = time.time()
    coord._CB_DoIdleAnalysis()
    t1 = time.time()
    [end_time] = host.fScanners.One(PRIMARY_WHOLE).fScans
    assert end_time - t1 - 1e-3 <= budget <= end_time - t0 + 1e-3


def run_optimised(body):
    """Run `body` in a fresh `python -O`; its last line of output is a JSON document."""
    env = dict(os.environ, PYTHONPATH=os.pathsep.join(p for p in sys.path if p))
    proc = subprocess.run([sys.executable, '-O', '-c', textwrap.dedent(body)],
                          capture_output=True, text=True, env=env, timeout=60, check=False)
    assert proc.returncode == 0, proc.stderr
    return json.loads(proc.stdout.strip().splitlines()[-1])


def test_under_python_O_the_budget_is_short_and_exceptions_are_swallowed():
    result = run_optimised('''
        import json, time, pytest
        from coord_doubles import Boom, Host, PRIMARY_WHOLE, kFinishedScanning, local, make_coord
        from ostrelutils import reflect
        with pytest.MonkeyPatch.context() as mp:
            host = Host().Patch(mp)
            coord = make_coord(host)
            a, b = local('a.py'), local('b.py')
            host.fScanners.Script(PRIMARY_WHOLE, b, [Boom('scan failed'), kFinishedScanning])
            coord.AddPairsToPrimaryQueue([(a, '*')], priority=0)
            coord.AddPairsToPrimaryQueue([(b, '*')], priority=1)
            t0 = time.time()
            first = coord._CB_DoIdleAnalysis()
            t1 = time.time()
            end_time = host.fScanners.Made()[0].fScans[0]
            out = {'debug': __debug__, 'budget': [end_time - t1, end_time - t0],
                   'result': repr(first), 'idle': coord._fIdleProcId,
                   'reports': [repr(e) for e in host.Reports()],
                   'last': coord.fLog.Messages()[-1], 'b': coord.LocationInPrimaryScanQueue(b)}
            def failing_report(*args):
                raise RuntimeError('reporter broken')
            mp.setattr(reflect, 'ReportCurrentException', failing_report)
            host.fScanners.Script(PRIMARY_WHOLE, local('c.py'), [Boom('again')])
            coord.AddPairsToPrimaryQueue([(local('c.py'), '*')], priority=0)
            out['failing report'] = repr(coord._CB_DoIdleAnalysis())
        print(json.dumps(out))
    ''')
    low, high = result.pop('budget')
    assert low - 1e-3 <= 0.05 <= high + 1e-3
    assert result == {'debug': False, 'result': 'None', 'idle': None,
                      'reports': ["Boom('scan failed')"], 'last': kExceptionMsg, 'b': True,
                      'failing report': 'None'}


def test_slices_return_true_while_a_scan_goes_on(coord, host):
    host.fScanners.Script(PRIMARY_WHOLE, A, [kReadyToScan, kTimedOut, kFinishedScanning])
    record_signals(coord, host.fLog, 'end')
    coord.AddPairsToPrimaryQueue([(A, '*')])
    sid = coord._fIdleProcId
    assert coord._CB_DoIdleAnalysis() is True
    assert coord._CB_DoIdleAnalysis() is True
    scanner = host.fScanners.One()
    assert coord._fIdleProcId == sid and active(coord, PRIMARY_WHOLE) == {A: scanner}
    assert host.fLog.find('signal') == [] and queued(coord) == {(A, '*', PRIMARY): 1}
    assert coord._CB_DoIdleAnalysis() is False
    assert coord._fIdleProcId is None and signals_of(host.fLog) == ['end']
    assert len(scanner.fScans) == 3 and scanner.fScans == sorted(set(scanner.fScans))
    assert coord.fLog.Messages() == [
        kEntering, checking([(A, 1)]), scans_done({A: ''}), scanning(A)[0], kNotEmptyMsg,
        kEntering, kNotEmptyMsg, kEntering, scanning(A)[1], *scanning(A, 'secondary'),
        kNoLocMsg, kEmptyMsg]


def test_work_waiting_for_data_ends_the_idle_without_end(coord, host):
    host.fScanners.Script(PRIMARY_WHOLE, A, [kWaitingForData, kFinishedScanning])
    record_signals(coord, host.fLog, 'end')
    coord.AddPairsToPrimaryQueue([(A, '*')])
    assert coord._CB_DoIdleAnalysis() is False
    assert data_waiting(coord) == {(A, '*', PRIMARY, 1)} and host.fLog.find('signal') == []
    assert coord._fActiveIdleStart >= 0  # the run of slices is not over
    assert coord._fIdleToWriteToDatabase is not None
    assert coord._CB_DoIdleAnalysis() is False
    assert len(pending_callbacks(coord, '_CB_WriteToDatabase')) == 1


def test_quitting_stops_the_next_slice(coord, host):
    coord.AddPairsToPrimaryQueue([(A, '*')])
    coord.Quitting()
    host.fLog.clear()
    assert coord._CB_DoIdleAnalysis() is False
    assert coord.fLog.Texts() == [kEntering, kQuittingMsg] and host.fLog == []
    assert coord._fIdleProcId is not None and coord._CScanCoordinator__fStatusTimeout is None


def test_waiting_for_remote_modules_does_no_work(coord, host):
    coord.AddPairsToPrimaryQueue([(A, '*')])
    host.fModFileCache.emit('suspend')
    host.fLog.clear()
    assert coord._CB_DoIdleAnalysis() is True
    assert coord.fLog.Messages() == [kEntering, kNotEmptyMsg] and host.fLog == []
    host.fModFileCache.emit('unsuspend')
    assert coord._CB_DoIdleAnalysis() is False
    assert len(host.fScanners.Made()) == 2


def test_basic_modules_are_queued_by_the_first_slice_that_finds_them(coord, host):
    builtins = local('stubs/builtins.pyi')
    coord.AddPairsToPrimaryQueue([(A, '*')], priority=2)
    coord._CB_DoIdleAnalysis()
    host.fFactory.SetBuiltins('builtins', [builtins])
    coord.AddPairsToPrimaryQueue([(B, '*')], priority=2)
    coord._CB_DoIdleAnalysis()
    # Queued at priority 0 and scanned in the same slice, before B.
    assert [s.fKey for s in host.fScanners.Made(PRIMARY_WHOLE)] == [A, builtins, B]
    finds = len(host.fLog.find('factory', 'FindBuiltinMod'))
    coord._CB_DoIdleAnalysis()
    assert len(host.fLog.find('factory', 'FindBuiltinMod')) == finds == 2


def test_the_whole_file_check(coord, host):
    fresh, both, nowant, missing, stale = (local('fresh.py'), local('both.py'),
                                           local('lib/nowant.py'), local('gone.py'),
                                           local('stale.py'))
    info = host.fInfoCache
    info.fMTimes[missing] = 0
    info.fScansDone.update({fresh: f'x {PRIMARY} y', both: f'{DERIVED} {PRIMARY}',
                            nowant: PRIMARY, stale: DERIVED})
    info.fImports.update({fresh: [b':ios'], both: [b':fpkg name', b':ios'],
                          nowant: [b':ire']})
    host.fLocCache.fAnswers[nowant] = False
    record_signals(coord, host.fLog, 'modtimes-updated')
    coord.AddPairsToSecondaryQueue([(fresh, 'f'), (missing, 'g')], priority=1)
    coord.AddPairsToPrimaryQueue([(fresh, '*')], priority=1)
    coord.AddPairsToPrimaryQueue([(both, '*'), (nowant, 'C.m'), (missing, '*'), (stale, '*')],
                                 priority=2)
    host.fLog.clear()

    assert coord._CScanCoordinator__CheckWholeFiles(time.time() + 10) is False

    # Up-to-date files leave the queue, a missing one too; the secondary scan of a
    # fresh file is queued where its derived scan is not done and wanted.
    assert queued(coord) == {(fresh, '*', DERIVED): 1, (stale, '*', PRIMARY): 2}
    assert coord._fMTimeAtLastWholeFileCheck == {fresh: 100.0, both: 100.0, nowant: 100.0,
                                                 missing: 0, stale: 100.0}
    assert host.fLog.args('info_cache', 'GetScansDoneForMultipleFiles') == [
        ({fresh: 100.0, both: 100.0, nowant: 100.0, stale: 100.0},)]
    # The imports of the up-to-date files, per (directory, priority).
    assert sorted((sorted(names), d, flag) for names, d, flag in host.fLog.args(
        'factory', '_FindPrimaryLocsForNames')) == [
        (['os'], local(''), False), (['os', 'pkg', 'pkg.name'], local(''), False),
        (['re'], local('lib'), False)]
    assert host.fLog.find('signal')[0].args == (coord._fMTimeAtLastWholeFileCheck,)
    assert coord.fLog.Texts()[0] == checking([(stale, 2), (missing, 2), (nowant, 2), (both, 2),
                                              (fresh, 1)])


@pytest.mark.parametrize('answer', [['not', 'a', 'dict'], 42])
def test_scans_done_of_the_wrong_type_takes_the_exception_path(coord, host, answer):
    host.fInfoCache.fScansDoneResult = answer
    coord.AddPairsToPrimaryQueue([(A, '*')])
    with pytest.raises((TypeError, AttributeError)) as exc_info:
        coord._CB_DoIdleAnalysis()
    assert host.Reports() == [exc_info.value]
    assert coord.fLog.Messages()[-2:] == [scans_done(answer), kExceptionMsg]
    assert coord._fIdleProcId is None and host.fScanners.Made() == []


def test_the_check_gives_up_after_a_batch_once_out_of_time(coord, host):
    coord.AddPairsToPrimaryQueue([(local(f'm{i:02}.py'), '*') for i in range(30)], priority=2)
    end_time = time.time() + 0.01

    def wait_for_deadline(loc):
        while time.time() <= end_time:
            time.sleep(0.001)

    host.fInfoCache.Probe('GetDiskMTime', wait_for_deadline)
    coord._CScanCoordinator__DoScans(end_time)
    assert len(host.fLog.find('info_cache', 'GetDiskMTime')) == 26
    assert len(coord._fScanQueue._fWholeFilesToCheck) == 4
    assert coord.fLog.Messages()[-1] == 'Out of time after whole file check'
    assert host.fScanners.Made() == []
    host.fLog.clear()
    coord._CScanCoordinator__DoScans(time.time() - 1.0)  # past its deadline
    assert [c.what for c in host.fLog] == ['FindBuiltinMod']


@pytest.mark.parametrize('age, skipped', [(4.9, True), (5.1, False)])
def test_recently_completed_scans_are_not_run_again(coord, host, age, skipped):
    coord.AddPairsToPrimaryQueue([(A, 'f')], priority=1)
    coord.AddPairsToPrimaryQueue([(B, 'g')], priority=2)
    t = time.time() - age
    coord._fLastScanCompleted[A] = {('f', PRIMARY): t, ('g', PRIMARY): time.time()}
    result = coord._CB_DoIdleAnalysis()
    made = [s.fKey for s in host.fScanners.Made(PRIMARY_SCOPE)]
    message = f'Skipping scan because last scan is too recent: {(A, "f", PRIMARY)!r}'
    if skipped:  # taken out of the queue, and the slice ends there
        assert (result, made, queued(coord)) == (True, [], {(B, 'g', PRIMARY): 2})
        assert message in coord.fLog.Messages()
        assert coord._fLastScanCompleted[A][('f', PRIMARY)] == t
    else:
        assert made == [(A, 'f'), (B, 'g')]
        assert coord._fLastScanCompleted[A][('f', PRIMARY)] > t + age - 1


@pytest.mark.parametrize('name, ana, is_python, asked', [
    ('stub.pyi', None, True, []),
    ('tool', None, True, ['IsPythonSource']),
    ('page.html', 'source', True, ['IsPythonSource', 'GetAnalysis']),
    ('notes.txt', None, False, ['IsPythonSource', 'GetAnalysis']),
    ('data.bin', 'other', False, ['IsPythonSource', 'GetAnalysis']),
])
def test_the_python_check(coord, host, monkeypatch, name, ana, is_python, asked):
    loc = local(name)
    host.fCacheMgr.fAnalyses[loc] = {None: None, 'other': object(),
                                     'source': Analysis(loc, host.fLog)}[ana]

    def is_python_source(arg):
        host.fLog.add('utils', 'IsPythonSource', arg)
        return arg == local('tool')

    monkeypatch.setattr(utils, 'IsPythonSource', is_python_source)
    host.fLocCache.fAnswers[loc] = False
    coord.AddPairsToPrimaryQueue([(loc, 'f')], priority=0)
    coord.AddPairsToPrimaryQueue([(B, 'g')], priority=1)
    host.fLog.clear()
    assert coord._CB_DoIdleAnalysis() is False
    made = [s.fKey for s in host.fScanners.Made(PRIMARY_SCOPE)]
    assert made == ([(loc, 'f')] if is_python else []) + [(B, 'g')]
    # (The scan itself looks for an existing analysis, without creating one.)
    assert [c.what for c in host.fLog if c.what in ('IsPythonSource', 'GetAnalysis')
            and c.args in ((loc,), (loc, True))] == asked
    removed = f'Removing scan because not python: {(loc, "f", PRIMARY)!r}'
    assert (removed in coord.fLog.Messages()) is not is_python
    assert queued(coord) == {} and (loc in coord._fLastScanCompleted) is is_python
    monkeypatch.setattr(analysis, 'CPySourceAnalysis', 'not a class')
    with pytest.raises(TypeError):  # the host's class check fails: the error propagates
        coord._CScanCoordinator__GetAnalysis(loc, True)


def test_secondary_scans_without_builtins_count_as_done(coord, host):
    host.fLocCache.fBuiltinLoc = None
    coord.AddPairsToSecondaryQueue([(A, '*'), (B, 'f')], priority=1)
    t0 = time.time()
    assert coord._CB_DoIdleAnalysis() is False
    assert host.fScanners.Made() == [] and queued(coord) == {}
    done = coord._fLastScanCompleted
    assert (set(done[A]), set(done[B])) == ({('*', DERIVED)}, {('f', DERIVED)})
    assert t0 <= done[A][('*', DERIVED)] <= done[B][('f', DERIVED)] <= time.time()
    assert coord._CScanCoordinator__fCompletedLocs == {A, B}
    assert len(host.fLog.find('info_cache', 'Trim')) == 2
    assert host.fLog.find('info_cache', 'FinishedWithScans') == []
    assert dict(coord._fScanTripleCompletedCount) == {}


def test_do_single_scan_bookkeeping(coord, host):
    seen = []

    def probe(scanner, end_time):
        seen.append(coord.fActiveScanItem)
        return kFinishedScanning

    items = [CScanItem(A, 'f', PRIMARY, 1), CScanItem(C, '*', 'other-scan', 0)]
    host.fScanners.Script(PRIMARY_SCOPE, (A, 'f'), [probe])
    host.fScanners.Script(SECONDARY_WHOLE, C, [probe])  # any other name is a secondary scan
    end_time = end_in()
    for item in items + items[:1]:
        assert coord._DoSingleScan(item, end_time) is False and coord.fActiveScanItem is None
    assert seen == items + items[:1]
    assert host.fLog.args('info_cache', 'FinishedWithScans') == [
        (A, 'f', PRIMARY), (C, '*', 'other-scan'), (A, 'f', PRIMARY)]
    assert dict(coord._fScanTripleCompletedCount) == {(A, 'f', PRIMARY): 2,
                                                       (C, '*', 'other-scan'): 1}
    host.fScanners.Script(PRIMARY_SCOPE, (B, 'f'), [kReadyToScan, Boom('bad')])
    item = CScanItem(B, 'f', PRIMARY, 1)
    assert coord._DoSingleScan(item, end_time) is True
    with pytest.raises(Boom):
        coord._DoSingleScan(item, end_time)
    assert coord.fActiveScanItem is None and (B, 'f', PRIMARY) not in \
        coord._fScanTripleCompletedCount


def test_a_failing_scanner_is_reported_reraised_and_resumed(coord, host):
    host.fScanners.Script(PRIMARY_WHOLE, A, [kReadyToScan, Boom('scan failed'),
                                             kFinishedScanning])
    record_signals(coord, host.fLog, 'scheduled')
    coord.AddPairsToPrimaryQueue([(A, '*')])
    sid = coord._fIdleProcId
    assert ostrelgtk.iteration() and ostrelgtk.iteration()
    # Reported by the coordinator, then by the main loop that got it re-raised.
    [first, second] = host.Reports()
    assert first is second and isinstance(first, Boom)
    assert coord.fLog.Messages()[-1] == kExceptionMsg
    assert not ostrelgtk.GetMainLoop().has_source(sid) and coord._fIdleProcId is None
    scanner = host.fScanners.One()
    assert active(coord, PRIMARY_WHOLE) == {A: scanner} and coord.fActiveScanItem is None
    assert queued(coord) == {(A, '*', PRIMARY): 1}
    coord._ScheduleIdle()
    assert ostrelgtk.run_until_idle(100)
    assert host.fScanners.Made(PRIMARY_WHOLE) == [scanner] and len(scanner.fScans) == 3
    assert coord.QueuesEmpty() and len(host.Reports()) == 2


def test_the_queue_listing_and_the_run_of_slices(coord, host):
    host.fScanners.Script(PRIMARY_WHOLE, A, [kReadyToScan] * 3 + [kFinishedScanning])
    coord.AddPairsToPrimaryQueue([(A, '*')])
    t0 = time.time()
    coord._CB_DoIdleAnalysis()
    start = coord._fActiveIdleStart
    assert t0 <= start <= time.time() and coord._fLastLogQueue == start
    coord._CB_DoIdleAnalysis()
    assert (coord._fActiveIdleStart, coord._fLastLogQueue) == (start, start)
    assert coord.fLog.Messages() == coord.fLog.Texts()  # no listing within two seconds
    time.sleep(2.01)
    n = len(coord.fLog.fCalls)
    coord._CB_DoIdleAnalysis()  # the queue is listed every two seconds of a run of slices
    assert coord.fLog.Texts()[n:n + 2] == [kEntering, '_CScanQueue contents:\n']
    assert coord._fLastLogQueue > start + 2 and coord._fActiveIdleStart == start
    coord._CB_DoIdleAnalysis()
    assert coord._fActiveIdleStart == -1.0
    texts = coord.fLog.Texts()
    assert texts[texts.index(kEmptyMsg) + 1] == '_CScanQueue contents:\n'
    coord.fLog.fCalls.clear()
    coord.fLog.fOutputFile = None  # logging off: no listing
    coord.AddPairsToPrimaryQueue([(B, '*')])
    coord._CB_DoIdleAnalysis()
    assert coord.fLog.Texts()[-1] == kEmptyMsg and coord.fLog.Messages() == coord.fLog.Texts()
