"""Override dispatch: each row names an overridable operation and an action that
makes the module call it internally; a Python subclass's override (which
records the call and delegates) must be called, and what it returns used."""
import time

import pytest
from coord_doubles import *
from doubles import AsyncLocation, LocalLocation
from queue_helpers import load_impl, make_queue

import pysource.scancoordinator as sc

A = local('a.py')
P = '_CScanCoordinator__'


def recording(base, names):
    """A subclass of `base` whose `names` record (name, args) in `self.fSeen`."""
    def override(name):
        def method(self, *args, **kwargs):
            self.__dict__.setdefault('fSeen', []).append((name, args))
            return getattr(base, name)(self, *args, **kwargs)
        return method
    return type('Recording', (base,), {n: override(n) for n in names})


def idle(c, h):
    c._CB_DoIdleAnalysis()


def queue_then_idle(pair):
    return lambda c, h: (c.AddPairsToPrimaryQueue([pair]), c._CB_DoIdleAnalysis())


def single_scan(scope, name=PRIMARY):
    return lambda c, h: c._DoSingleScan(CScanItem(A, scope, name, 1), end_in())


kCoordinatorRows = {
    '_ScheduleIdle': lambda c, h: c.AddPairsToPrimaryQueue([(A, 'f')]),
    '_CancelIdle': lambda c, h: c.SuspendIdleScans(),
    'QueuesEmpty': lambda c, h: (c.SuspendIdleScans(), c.ResumeIdleScans()),
    'AddPairsToPrimaryQueue': lambda c, h: c.AddNeedsScanSetToQueues([(A, 'f', PRIMARY)]),
    'AddPairsToSecondaryQueue': lambda c, h: c.AddNeedsScanSetToQueues([(A, 'f', DERIVED)]),
    '_CanSendToHelperProcess': lambda c, h: (h.UseHelper(),
                                             c.AddPairsToPrimaryQueue([(A, '*')])),
    'ClearLastScanInfo': lambda c, h: Analysis(A, h.fLog).NotifyModified(),
    'GetStatus': lambda c, h: c._CB_UpdateStatus(),
    f'{P}EnsureStatusTimeout': idle,
    '_ScheduleWriteToDatabaseIdle': idle,
    '_QueueBasicModules': idle,
    f'{P}DoScans': idle,
    f'{P}CheckWholeFiles': idle,
    '_DoSingleScan': queue_then_idle((A, 'f')),
    f'{P}GetAnalysis': queue_then_idle((local('notes.txt'), 'f')),
    f'{P}GetModtimeDict': queue_then_idle((A, '*')),
    f'{P}DoPrimaryWholeFileScan': single_scan('*'),
    f'{P}DoPrimarySingleScopeScan': single_scan('f'),
    f'{P}DoSecondaryWholeFileScan': single_scan('*', DERIVED),
    f'{P}DoSecondarySingleScopeScan': single_scan('f', DERIVED),
    f'{P}AddImportEquivsToQueue': single_scan('*'),
    '_WaitForScannerToBeReady': lambda c, h: (
        h.fScanners.Script(PRIMARY_WHOLE, A, [kWaitingForData]), single_scan('*')(c, h)),
    'BuildInstanceScopeNoScanning': single_scan('C()'),
    'TryToScanNow': lambda c, h: c.TryToScanDictNow(A, 'f', [(A, 'f', PRIMARY)], end_in()),
    '_TryToScanInstanceScopeNow': lambda c, h: c.TryToScanNow(A, 'C()', None, end_in()),
    'AddNeedsScanSetToQueues': lambda c, h: c.TryToScanDictNow(  # out of time
        A, 'f', [(A, 'f', PRIMARY), (A, 'g', PRIMARY)], time.time() - 1),
}


@pytest.mark.parametrize('name', list(kCoordinatorRows))
def test_the_coordinator_calls_every_override(host, name):
    coord = make_coord(host, recording(CScanCoordinator, list(kCoordinatorRows)))
    coord.fSeen = []
    kCoordinatorRows[name](coord, host)
    assert name in [seen for seen, _args in coord.fSeen]
    coord.destroy()


X = AsyncLocation('x.py')


ITEM = sc.CScanItem(A, 'f', 'primary', 2)


def make_parked(q, cache):
    cache.fReady.add(X)
    q.AddScanPairs([(X, 'f')], 'primary')
    cache.MakeUnready([X])
    q.First()


kQueueRows = [
    ('AddScanPairs', None, lambda q, cache: (
        q.StartWaitingForData(ITEM), q.FinishedWaitingForData(ITEM))),
    ('_AddReadyScanPairs', None, lambda q, cache: q.AddScanPairs([(A, 'f')], 'primary')),
    ('_GetSingleQueue', ('primary', 2), lambda q, cache: q.AddScanPairs([(A, 'f')], 'primary')),
    ('_UpdatePendingSets', ({A}, set()), lambda q, cache: q.AddScanPairs([(A, 'f')], 'primary')),
    ('_UpdatePendingSets', (None, {A}), lambda q, cache: (
        q.AddScanPairs([(A, 'f')], 'primary'), q.RemoveScanTriple((A, 'f', 'primary')))),
    ('_UpdatePendingSets', (None, set()), lambda q, cache: q.Clear()),
    ('RemoveScanTriple', None, lambda q, cache: q.ScanCompleted(ITEM)),
    ('_FirstOrNone', (), lambda q, cache: q.First()),
    ('IsTreeBranchReady', (X,), make_parked),
    ('_MoveScansForLocToWaitingForInspect', (X, None), make_parked),
    ('Clear', (), lambda q, cache: q.destroy()),
]


@pytest.mark.parametrize('name, args, action', kQueueRows)
def test_the_queue_calls_every_override(async_probe, data_cache, name, args, action):
    cls = recording(sc._CScanQueue, sorted({row[0] for row in kQueueRows}))
    q = make_queue(load_impl('compiled'), data_cache, cls=cls)
    q.fSeen = []
    action(q, data_cache)
    assert name in [seen for seen, _args in q.fSeen]
    if args is not None:
        assert (name, args) in q.fSeen
    q.destroy()


def test_what_an_override_returns_is_used(host, data_cache):
    class Holding(CScanCoordinator):
        def _DoSingleScan(self, scan_item, end_time):
            return True  # holds the loop: the scan goes on

        def _QueueBasicModules(self, end_time):
            return self.fEarly

    coord = make_coord(host, Holding)
    coord.fEarly = False
    coord.AddPairsToPrimaryQueue([(A, 'f')])
    assert coord._CB_DoIdleAnalysis() is True and queued(coord) == {(A, 'f', PRIMARY): 1}
    assert host.fScanners.Made() == [] and coord._fLastScanCompleted == {}
    coord.fEarly = True  # the slice ends there, before the whole-file check
    coord.AddPairsToPrimaryQueue([(local('b.py'), '*')])
    host.fLog.clear()
    assert coord._CB_DoIdleAnalysis() is True and host.fLog.find('info_cache') == []
    coord.destroy()

    class BadQueue(sc._CScanQueue):
        def _GetSingleQueue(self, scan_name, priority):
            return 'not a single queue'

    q = BadQueue(data_cache)
    with pytest.raises(TypeError, match='^Expected _CSingleScanQueue, got str$'):
        q.AddScanPairs([(LocalLocation('a.py'), 'f')], 'primary')
    q.destroy()


def test_a_method_of_another_object_is_an_override(host):
    """Dispatch looks at the bound method: our own built-in method bound to another
    coordinator is that coordinator's operation, not this one's."""
    coord, other = make_coord(host), make_coord(host)
    sub = make_coord(host, type('Sub', (CScanCoordinator,), {}))
    sub._ScheduleIdle = other._ScheduleIdle
    sub.AddPairsToPrimaryQueue([(A, 'f')])
    assert sub._fIdleProcId is None and other._fIdleProcId is not None
    sub._ScheduleIdle = len  # a built-in function of another module
    with pytest.raises(TypeError):
        sub.AddPairsToPrimaryQueue([(A, 'g')])
    for c in (coord, other, sub):
        c.destroy()
