"""CScanCoordinator: status reports and database writes.

Covers the status record, the one-second status timeout (installed by the idle
loop while work is queued, removed by its own callback once the queues are
empty) and the database-write idle (at most one pending, asked for when the
idle loop finds the queue empty).

Tests that take `scoord` run on the class and on ScanCountingCoordinator; on
the latter they also check the calls of the coordinator's own operations.
"""
import pytest
from coord_doubles import *
from coord_doubles import (
    DERIVED,
    PRIMARY,
    Boom,
    GtkSpy,
    local,
    make_coord,
    record_signals,
    remote,
)
from guiutils import ostrelgtk
from scan_doubles import *
from scan_doubles import (
    PRIMARY_WHOLE,
    ScanCountingCoordinator,
    is_counting,
    kFinishedScanning,
    kReadyToScan,
    kWaitingForData,
    pending_callbacks,
    take_over_idle,
)

from pysource import scancoordinator

CScanStatus = scancoordinator.CScanStatus
CSingleQueueStatus = scancoordinator.CSingleQueueStatus

A, B, C, D = (local(f'{n}.py') for n in 'abcd')
W = remote('w.py')  # never inspected: its scans wait


def status_timeout(coord):
    return coord._CScanCoordinator__fStatusTimeout


@pytest.fixture
def clock():
    """The main loop's clock, advanced by hand (the coordinator's own clock is not)."""
    fake = ostrelgtk.CFakeClock()
    ostrelgtk.set_clock(fake)
    return fake


def tick(clock):
    clock.advance(1000)
    assert ostrelgtk.iteration()


# ---- the status record --------------------------------------------------------------

def test_status_lists_non_empty_queues_in_order(scoord, shost):
    scoord.AddPairsToPrimaryQueue([(A, 'f'), (A, 'g'), (B, '*')], priority=2)
    scoord.AddPairsToSecondaryQueue([(C, 'h')], priority=2)
    scoord.AddPairsToSecondaryQueue([(D, '*')], priority=1)
    scoord.AddPairsToPrimaryQueue([(C, '*')], priority=0)
    scoord.AddPairsToPrimaryQueue([(D, 'x')], priority=1)
    scoord.RemoveLocationsFromQueue([D])  # its two single queues are left empty
    scoord.AddPairsToPrimaryQueue([(W, '*')])  # waits for inspection
    status = scoord.GetStatus()
    assert type(status) is CScanStatus
    assert status == CScanStatus([CSingleQueueStatus(PRIMARY, 0, 1),
                                  CSingleQueueStatus(PRIMARY, 2, 2),
                                  CSingleQueueStatus(DERIVED, 2, 1)], 1)
    assert all(type(q) is CSingleQueueStatus for q in status.queue_status_list)
    assert type(status.queue_status_list) is list


def test_status_of_an_empty_queue(scoord, shost):
    assert scoord.GetStatus() == CScanStatus([], 0)
    scoord.AddPairsToPrimaryQueue([(A, '*')])
    scoord.RemoveLocationsFromQueue([A])
    scoord.AddPairsToPrimaryQueue([(W, '*')])
    assert scoord.GetStatus() == CScanStatus([], 1)


# ---- the status timeout ----------------------------------------------------------------

def test_status_timeout_is_installed_only_with_work(scoord, shost, monkeypatch):
    spy = GtkSpy(monkeypatch, shost.fLog)
    ensure = scoord._CScanCoordinator__EnsureStatusTimeout
    assert ensure() is None
    scoord.AddPairsToPrimaryQueue([(W, '*')])  # waiting work does not count
    ensure()
    assert status_timeout(scoord) is None
    assert spy.fLog.find('gtk', 'timeout_add_while_alive') == []

    scoord.AddPairsToPrimaryQueue([(A, '*')])
    ensure()
    ensure()
    [call] = shost.fLog.find('gtk', 'timeout_add_while_alive')
    interval, callback, owner = call.args
    assert interval == 1000 and owner is scoord
    assert callback == scoord._CB_UpdateStatus
    assert status_timeout(scoord) == call.kwargs['result']


def test_status_ticks_until_the_queues_are_empty(scoord, shost, clock):
    shost.fScanners.Script(PRIMARY_WHOLE, B, [kWaitingForData])
    record_signals(scoord, shost.fLog, 'scan-status-update')
    scoord.AddPairsToPrimaryQueue([(A, 'f')], priority=1)
    scoord.AddPairsToPrimaryQueue([(B, '*')], priority=2)
    take_over_idle(scoord)
    scoord._CScanCoordinator__EnsureStatusTimeout()
    tid = status_timeout(scoord)

    tick(clock)
    [update] = shost.fLog.find('signal')
    assert update.args == (scoord, CScanStatus([CSingleQueueStatus(PRIMARY, 1, 1),
                                                CSingleQueueStatus(PRIMARY, 2, 1)], 0))
    assert ostrelgtk.GetMainLoop().has_source(tid)

    # A is done; B's scanner waits for data, which does not keep the timeout alive.
    assert scoord._CB_DoIdleAnalysis() is False
    shost.fLog.clear()
    tick(clock)
    assert [c.args for c in shost.fLog.find('signal')] == [(scoord, CScanStatus([], 1))]
    assert status_timeout(scoord) is None
    assert not ostrelgtk.GetMainLoop().has_source(tid)
    assert pending_callbacks(scoord, '_CB_UpdateStatus') == []
    if is_counting(scoord):
        assert len(scoord.Called('_CB_UpdateStatus')) == 2
        assert len(scoord.Called('GetStatus')) == 2


def test_update_status_return_values(scoord, shost):
    scoord.AddPairsToPrimaryQueue([(A, '*')])
    scoord._CScanCoordinator__EnsureStatusTimeout()
    assert scoord._CB_UpdateStatus() is True
    assert status_timeout(scoord) is not None
    scoord.RemoveLocationsFromQueue([A])
    assert scoord._CB_UpdateStatus() is False
    assert status_timeout(scoord) is None


def test_each_slice_makes_sure_the_status_timeout_runs(scoord, shost):
    shost.fScanners.Script(PRIMARY_WHOLE, A, [kReadyToScan, kReadyToScan, kFinishedScanning])
    scoord.AddPairsToPrimaryQueue([(A, '*')])
    scoord._CB_DoIdleAnalysis()
    tid = status_timeout(scoord)
    assert ostrelgtk.GetMainLoop().has_source(tid)
    scoord._CB_DoIdleAnalysis()
    assert status_timeout(scoord) == tid
    if is_counting(scoord):
        assert scoord.Called('__EnsureStatusTimeout') == [()]
    assert len(pending_callbacks(scoord, '_CB_UpdateStatus')) == 1


def test_failing_status_update_leaves_the_timeout_set(shost):
    class Failing(ScanCountingCoordinator):
        def GetStatus(self):
            raise Boom('no status')

    coord = make_coord(Failing, shost)
    coord.AddPairsToPrimaryQueue([(A, '*')])
    coord._CScanCoordinator__EnsureStatusTimeout()
    tid = status_timeout(coord)
    with pytest.raises(Boom):
        coord._CB_UpdateStatus()
    assert status_timeout(coord) == tid
    coord.destroy()


# ---- database writes --------------------------------------------------------------------

def test_one_database_write_at_a_time(scoord, shost):
    assert scoord._ScheduleWriteToDatabaseIdle() is None
    sid = scoord._fIdleToWriteToDatabase
    scoord._ScheduleWriteToDatabaseIdle()
    assert scoord._fIdleToWriteToDatabase == sid
    [src] = pending_callbacks(scoord, '_CB_WriteToDatabase')
    assert src.fId == sid and src.fPriority == ostrelgtk.PRIORITY_DEFAULT_IDLE

    seen = []
    shost.fInfoCache.Probe('WriteToDatabase',
                           lambda: seen.append(scoord._fIdleToWriteToDatabase))
    assert ostrelgtk.run_until_idle(10)
    assert seen == [None]  # cleared before the cache is asked
    assert len(shost.fLog.find('info_cache', 'WriteToDatabase')) == 1
    scoord._ScheduleWriteToDatabaseIdle()
    assert scoord._fIdleToWriteToDatabase is not None
    if is_counting(scoord):
        assert scoord.Called('_CB_WriteToDatabase') == [()]


def test_write_goes_to_the_analysis_managers_current_cache(scoord, shost):
    class OtherCache:
        def __init__(self):
            self.fWrites = 0

        def WriteToDatabase(self):
            self.fWrites += 1
            return 123

    other = OtherCache()
    shost.fAnaMgr.fInfoCache = other
    assert scoord._CB_WriteToDatabase() is None
    assert other.fWrites == 1
    assert shost.fLog.find('info_cache', 'WriteToDatabase') == []


def test_failing_write_can_be_asked_for_again(scoord, shost):
    scoord._ScheduleWriteToDatabaseIdle()
    shost.fInfoCache.Fail('WriteToDatabase', Boom('disk full'))
    with pytest.raises(Boom):
        scoord._CB_WriteToDatabase()
    assert scoord._fIdleToWriteToDatabase is None
    scoord._ScheduleWriteToDatabaseIdle()
    assert scoord._fIdleToWriteToDatabase is not None


def test_pending_write_ends_with_the_coordinator(scoord, shost):
    scoord._ScheduleWriteToDatabaseIdle()
    scoord.destroy()
    assert pending_callbacks(scoord, '_CB_WriteToDatabase') == []
    assert ostrelgtk.run_until_idle(10)
    assert shost.fLog.find('info_cache', 'WriteToDatabase') == []
