"""CScanCoordinator: the status record, the one-second status timeout and the
database-write idle."""
import pytest
from coord_doubles import *
from guiutils import ostrelgtk

from pysource.scancoordinator import CScanStatus, CSingleQueueStatus

A, B, C, D = (local(f'{n}.py') for n in 'abcd')
W = remote('w.py')  # never inspected: its scans wait


def status_timeout(coord):
    return coord._CScanCoordinator__fStatusTimeout


def test_the_status_lists_non_empty_queues_in_order(coord):
    assert coord.GetStatus() == CScanStatus([], 0)
    coord.AddPairsToPrimaryQueue([(A, 'f'), (A, 'g'), (B, '*')], priority=2)
    coord.AddPairsToSecondaryQueue([(C, 'h')], priority=2)
    coord.AddPairsToSecondaryQueue([(D, '*')], priority=1)
    coord.AddPairsToPrimaryQueue([(C, '*')], priority=0)
    coord.RemoveLocationsFromQueue([D])  # its single queue is left empty
    coord.AddPairsToPrimaryQueue([(W, '*')])  # waits for inspection
    status = coord.GetStatus()
    assert type(status) is CScanStatus and type(status.queue_status_list) is list
    assert status == ([CSingleQueueStatus(PRIMARY, 0, 1), CSingleQueueStatus(PRIMARY, 2, 2),
                       CSingleQueueStatus(DERIVED, 2, 1)], 1)
    assert all(type(q) is CSingleQueueStatus for q in status.queue_status_list)


def test_the_status_timeout_ticks_while_work_is_queued(coord, host):
    clock = ostrelgtk.CFakeClock()
    ostrelgtk.set_clock(clock)
    ensure = coord._CScanCoordinator__EnsureStatusTimeout
    coord.AddPairsToPrimaryQueue([(W, '*')])
    ensure()  # waiting work does not count
    assert status_timeout(coord) is None
    host.fScanners.Script(PRIMARY_WHOLE, B, [kWaitingForData])
    record_signals(coord, host.fLog, 'scan-status-update')
    coord.AddPairsToPrimaryQueue([(A, 'f')], priority=1)
    coord.AddPairsToPrimaryQueue([(B, '*')], priority=2)
    take_over_idle(coord)
    ensure()
    ensure()
    tid = status_timeout(coord)
    [src] = pending_callbacks(coord, '_CB_UpdateStatus')
    assert src.fId == tid and src.fIntervalMs == 1000

    clock.advance(1000)
    assert ostrelgtk.iteration()
    assert [c.args for c in host.fLog.find('signal')] == [(coord, CScanStatus(
        [CSingleQueueStatus(PRIMARY, 1, 1), CSingleQueueStatus(PRIMARY, 2, 1)], 1))]
    # A is done; B's scanner waits for data, which does not keep the timeout alive.
    assert coord._CB_DoIdleAnalysis() is False
    assert status_timeout(coord) == tid  # the slice found it running
    host.fLog.clear()
    clock.advance(1000)
    assert ostrelgtk.iteration()
    assert [c.args for c in host.fLog] == [(coord, CScanStatus([], 2))]
    assert status_timeout(coord) is None and pending_callbacks(coord, '_CB_UpdateStatus') == []
    coord.AddPairsToPrimaryQueue([(C, '*')])
    ensure()
    assert coord._CB_UpdateStatus() is True and status_timeout(coord) is not None


def test_a_failing_status_update_leaves_the_timeout_set(host):
    class Failing(CScanCoordinator):
        def GetStatus(self):
            raise Boom('no status')

    coord = make_coord(host, Failing)
    coord.AddPairsToPrimaryQueue([(A, '*')])
    coord._CScanCoordinator__EnsureStatusTimeout()
    tid = status_timeout(coord)
    with pytest.raises(Boom):
        coord._CB_UpdateStatus()
    assert status_timeout(coord) == tid
    coord.destroy()


def test_one_database_write_at_a_time(coord, host):
    assert coord._ScheduleWriteToDatabaseIdle() is None
    sid = coord._fIdleToWriteToDatabase
    coord._ScheduleWriteToDatabaseIdle()
    [src] = pending_callbacks(coord, '_CB_WriteToDatabase')
    assert src.fId == sid and src.fPriority == ostrelgtk.PRIORITY_DEFAULT_IDLE
    seen = []
    host.fInfoCache.Probe('WriteToDatabase', lambda: seen.append(coord._fIdleToWriteToDatabase))
    assert ostrelgtk.run_until_idle(10)
    assert seen == [None]  # cleared before the cache is asked
    host.fInfoCache.Fail('WriteToDatabase', Boom('disk full'))
    coord._ScheduleWriteToDatabaseIdle()
    with pytest.raises(Boom):
        coord._CB_WriteToDatabase()
    assert coord._fIdleToWriteToDatabase is None  # a failed write can be asked for again
    coord._ScheduleWriteToDatabaseIdle()
    coord.destroy()
    assert pending_callbacks(coord, '_CB_WriteToDatabase') == []
