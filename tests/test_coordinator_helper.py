"""CScanCoordinator: following the helper process.

Covers `_UpdateForHelperProcess`: taking work back when the helper process is
gone, handing queued whole-file primary scans over when a new callback object
appears (which scans move, in which order and at which priority), connecting
the callback object's two signals class-wide once, what the signals do to the
record of work queued in the helper, a hand-over that fails, a callback object
without a proxy, and the end of the connections with the coordinator.

Tests that take `coord` run on the class and on CountingCoordinator; on the
latter they also check the calls that reached the overrides.
"""
import gc
import weakref
from types import SimpleNamespace

import pytest
import singleton
from coord_doubles import *
from coord_doubles import (
    DERIVED,
    PRIMARY,
    Boom,
    CoordHost,
    CountingCoordinator,
    CScanCoordinator,
    analysis_idles,
    counted,
    kBackgroundPriority,
    local,
    make_coord,
    queued,
    remote,
)
from guiutils import ostrelgtk
from ostrelbase import destroyable
from scan_doubles import *
from scan_doubles import PRIMARY_WHOLE, kFinishedScanning
from scanqueue_fixtures import check_invariants
from syncscan_doubles import helper_callback_class

A = local('a.py')
B = local('b.py')
C = local('c.py')
D = local('d.py')
E = local('e.py')
F = local('f.py')
G = local('g.py')
H = local('h.py')
R = remote('r.py')

ADDED = 'scan-queue-locs-added'
REMOVED = 'scan-queue-locs-removed'


def install_callback_obj(host, obj):
    host.fAnaMgr._fHelperProcessSupport = SimpleNamespace(fHelperCallbackObj=obj)
    return obj


def helper_calls(host):
    return [(c.what, c.args, c.kwargs) for c in host.fLog.find('helper')]


def primary_single_queues(coord):
    return [sq for sq in coord._fScanQueue._fOrderedQueues if sq.fScanName == PRIMARY]


# ---- no helper process ---------------------------------------------------------------------

def test_work_recorded_in_a_gone_helper_is_queued_again(coord, host):
    coord._fLocsQueuedInHelper.update({A, B, C})
    order = list(coord._fLocsQueuedInHelper)

    assert coord._UpdateForHelperProcess() is None

    assert coord._fLocsQueuedInHelper == set()
    assert queued(coord) == {(loc, '*', PRIMARY): kBackgroundPriority for loc in (A, B, C)}
    assert len(analysis_idles(coord)) == 1
    assert helper_calls(host) == []
    if counted(coord, 'AddPairsToPrimaryQueue') is not None:
        assert coord.Called('AddPairsToPrimaryQueue') == [
            ([(loc, '*') for loc in order], False, None)]


def test_work_taken_back_during_a_scan_gets_the_scans_priority(scoord, shost):
    X = local('x.py')
    scoord._fLocsQueuedInHelper.update({A, B})
    seen = []

    def step(scanner, end_time):
        scoord._UpdateForHelperProcess()
        seen.append((set(scoord._fLocsQueuedInHelper), dict(queued(scoord))))
        return kFinishedScanning
    shost.fScanners.Script(PRIMARY_WHOLE, X, [step])
    scoord.AddPairsToPrimaryQueue([(X, '*')], priority=0)
    ostrelgtk.idle_remove(scoord._fIdleProcId)
    scoord._CB_DoIdleAnalysis()

    assert seen == [(set(), {(X, '*', PRIMARY): 0, (A, '*', PRIMARY): 0,
                             (B, '*', PRIMARY): 0})]


def test_nothing_recorded_and_no_callback_object_does_nothing(coord, host):
    coord.AddPairsToPrimaryQueue([(A, '*')])
    before = queued(coord)
    host.fLog.clear()
    if counted(coord, 'AddPairsToPrimaryQueue') is not None:
        coord.fCalls.clear()

    coord._UpdateForHelperProcess()
    host.UseHelper()
    host.fAnaMgr._fHelperProcessSupport = SimpleNamespace(fHelperCallbackObj=None)
    coord._UpdateForHelperProcess()

    assert queued(coord) == before
    assert coord._fHelperCallbackObjConnected is None
    assert host.fLog.find('helper') == [] and host.fLog.find('cache_mgr') == []
    if counted(coord, 'AddPairsToPrimaryQueue') is not None:
        assert coord.fCalls == []


# ---- a new helper process --------------------------------------------------------------------

@pytest.fixture
def mixed_queue(coord, host):
    """Primary and secondary work at three priorities, queued while no helper runs."""
    host.fDataCache.fReady.add(R)
    coord.AddPairsToPrimaryQueue([(A, '*'), (H, 'f'), (B, '*'), (R, '*')], priority=2)
    coord.AddPairsToPrimaryQueue([(C, '*'), (D, 'Cls.m'), (D, 'f'), (E, '*')], priority=1)
    coord.AddPairsToPrimaryQueue([(G, '*')], priority=0)
    coord.AddPairsToSecondaryQueue([(F, '*')], priority=1)
    host.fCacheMgr.OpenBuffer(E)
    host.fLog.clear()
    if counted(coord, 'AddPairsToPrimaryQueue') is not None:
        coord.fCalls.clear()


def test_a_new_helper_takes_the_queued_local_whole_files(coord, host, mixed_queue):
    Callbacks = helper_callback_class()
    obj = install_callback_obj(host, Callbacks())
    host.UseHelper()
    seen = []
    host.fHelper.Probe('AddPairsToPrimaryQueue', lambda pairs, **kw: seen.append(
        set(queued(coord))))
    # What the rule picks, per primary single queue in queue order.
    expected = []
    for sq in primary_single_queues(coord):
        locs = [loc for loc, names in sq.fOrderedDict.items()
                if names == ['*'] and loc in (A, B, C, G)]
        if locs:
            expected.append(([(loc, '*') for loc in locs], sq.fPriority))
    assert [prio for _pairs, prio in expected] == [0, 1, 2]
    assert sorted(loc for pairs, _ in expected for loc, _s in pairs) == [A, B, C, G]

    assert coord._UpdateForHelperProcess() is None

    assert helper_calls(host) == [('AddPairsToPrimaryQueue', (pairs,), {'priority': prio})
                                  for pairs, prio in expected]
    # Each queue's scans left the local queue before they were handed over.
    handed = [set(pairs) for pairs, _ in expected]
    for i, snapshot in enumerate(seen):
        gone = {(loc, '*', PRIMARY) for done in handed[:i + 1] for loc, _s in done}
        assert not snapshot & gone
    # Scans of other names, other scope lists, remote and open files stay here.
    assert queued(coord) == {(R, '*', PRIMARY): 2, (H, 'f', PRIMARY): 2,
                             (D, 'Cls.m', PRIMARY): 1,
                             (D, 'f', PRIMARY): 1, (E, '*', PRIMARY): 1,
                             (F, '*', DERIVED): 1}
    check_invariants(coord._fScanQueue)
    # The helper reports what it queued itself.
    assert coord._fLocsQueuedInHelper == set()
    assert coord._fHelperCallbackObjConnected is obj
    assert [(signal, type(cb), owner) for signal, cb, owner in Callbacks.fConnects] == [
        (REMOVED, ostrelgtk.NoObjCallback, coord), (ADDED, ostrelgtk.NoObjCallback, coord)]
    if counted(coord, '_CanSendToHelperProcess') is not None:
        # Asked only about the whole-file primary scans, queue by queue.
        asked = [args[0] for args in coord.Called('_CanSendToHelperProcess')]
        assert sorted(asked) == sorted([A, B, C, E, G, R])
        assert all(args[1] == '*' for args in coord.Called('_CanSendToHelperProcess'))
        assert asked.index(G) < asked.index(C) < asked.index(A)


def test_the_same_callback_object_moves_and_connects_once(coord, host):
    class EqualCallbacks(helper_callback_class()):
        def __eq__(self, other):
            return isinstance(other, EqualCallbacks)

        __hash__ = destroyable.CDestroyable.__hash__

    obj = install_callback_obj(host, EqualCallbacks())
    host.UseHelper()
    coord._UpdateForHelperProcess()
    # Local work that the helper could take (put straight into the scan queue).
    coord._fScanQueue.AddScanPairs([(B, '*')], PRIMARY, 2)
    host.fLog.clear()

    coord._UpdateForHelperProcess()
    install_callback_obj(host, EqualCallbacks())  # another object, but equal
    coord._UpdateForHelperProcess()

    assert helper_calls(host) == []
    assert queued(coord) == {(B, '*', PRIMARY): 2}
    assert len(EqualCallbacks.fConnects) == 2
    assert coord._fHelperCallbackObjConnected is obj

    # A different object is a new helper: it gets the work and its own connections.
    Other = helper_callback_class('OtherCallbacks')
    other = install_callback_obj(host, Other())
    coord._UpdateForHelperProcess()
    assert helper_calls(host) == [('AddPairsToPrimaryQueue', ([(B, '*')],), {'priority': 2})]
    assert len(Other.fConnects) == 2
    assert coord._fHelperCallbackObjConnected is other


def test_the_helpers_reports_keep_the_record_of_its_work(coord, host):
    Callbacks = helper_callback_class()
    install_callback_obj(host, Callbacks())
    host.UseHelper()
    coord._UpdateForHelperProcess()
    assert coord.QueuesEmpty() is True

    reporter = Callbacks()  # any instance of the class reports
    reporter.emit(ADDED, reporter, [A, B])
    assert coord._fLocsQueuedInHelper == {A, B}
    assert coord.QueuesEmpty() is False
    reporter.emit(ADDED, reporter, (C,))
    reporter.emit(REMOVED, reporter, [B, C, D])  # D was never recorded
    assert coord._fLocsQueuedInHelper == {A}
    assert coord.QueuesEmpty() is False
    assert coord.QueuesEmpty(False) is False

    # Objects of another class are not followed.
    stranger = helper_callback_class('Stranger')()
    stranger.emit(REMOVED, stranger, [A])
    assert coord._fLocsQueuedInHelper == {A}

    reporter.emit(REMOVED, reporter, [A])
    assert coord._fLocsQueuedInHelper == set()
    assert coord.QueuesEmpty() is True


def test_a_failed_hand_over_is_repeated_by_the_next_call(coord, host):
    Callbacks = helper_callback_class()
    obj = install_callback_obj(host, Callbacks())
    coord.AddPairsToPrimaryQueue([(C, '*')], priority=1)
    coord.AddPairsToPrimaryQueue([(A, '*')], priority=2)
    host.UseHelper()
    host.fHelper.Fail('AddPairsToPrimaryQueue', Boom('helper gone'))

    with pytest.raises(Boom, match='helper gone'):
        coord._UpdateForHelperProcess()
    assert coord._fHelperCallbackObjConnected is None
    assert Callbacks.fConnects == []
    assert (A, '*', PRIMARY) in queued(coord)  # the later queue was not reached

    host.fHelper.Fail('AddPairsToPrimaryQueue', None)
    host.fLog.clear()
    coord._UpdateForHelperProcess()
    assert helper_calls(host)[-1] == ('AddPairsToPrimaryQueue', ([(A, '*')],), {'priority': 2})
    assert (A, '*', PRIMARY) not in queued(coord)
    assert [signal for signal, _cb, _owner in Callbacks.fConnects] == [REMOVED, ADDED]
    assert coord._fHelperCallbackObjConnected is obj


def test_a_callback_object_without_a_proxy_keeps_the_work_local(coord, host):
    Callbacks = helper_callback_class()
    obj = install_callback_obj(host, Callbacks())
    coord.AddPairsToPrimaryQueue([(A, '*'), (B, '*')], priority=2)
    coord._fLocsQueuedInHelper.add(C)
    before = {**queued(coord), (C, '*', PRIMARY): kBackgroundPriority}

    coord._UpdateForHelperProcess()

    assert queued(coord) == before
    assert helper_calls(host) == []
    assert coord._fLocsQueuedInHelper == set()
    assert [signal for signal, _cb, owner in Callbacks.fConnects if owner is coord] == [
        REMOVED, ADDED]
    assert coord._fHelperCallbackObjConnected is obj
    reporter = Callbacks()
    reporter.emit(ADDED, reporter, [D])
    assert coord._fLocsQueuedInHelper == {D}


# ---- the end of the connections ---------------------------------------------------------------

def test_destroying_the_coordinator_ends_the_class_wide_connections(coord, host):
    Callbacks = helper_callback_class()
    install_callback_obj(host, Callbacks())
    host.UseHelper()
    owned = destroyable._debug_owned_count(coord)
    coord._UpdateForHelperProcess()
    assert destroyable._debug_owned_count(coord) == owned + 2

    coord.destroy()
    assert destroyable._debug_owned_count(coord) == 0
    reporter = Callbacks()
    reporter.emit(ADDED, reporter, [A])
    assert coord._fLocsQueuedInHelper == set()


@pytest.mark.parametrize('cls', [CScanCoordinator, CountingCoordinator],
                         ids=['class', 'counting-subclass'])
def test_a_connected_coordinator_is_freed_after_destroy(host_reset, cls):
    h = CoordHost().Install()
    Callbacks = helper_callback_class(record=False)
    install_callback_obj(h, Callbacks())
    h.UseHelper()
    c = make_coord(cls, h)
    h.fAnaMgr.fScanCoordinator = c
    c._UpdateForHelperProcess()
    ref = weakref.ref(c)

    c.destroy()
    h.Destroy()
    singleton.ResetSingletons()
    del c, h
    gc.collect()
    assert ref() is None
    reporter = Callbacks()
    reporter.emit(ADDED, reporter, [A])  # nobody is left to hear it
