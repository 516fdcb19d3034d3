"""CScanCoordinator: following the helper process (`_UpdateForHelperProcess`).
Taking work back when the helper is gone, handing queued whole-file primary
scans to a new one, its two class-wide signals, and the end of the connections."""
from types import SimpleNamespace

import pytest
from coord_doubles import *
from guiutils import ostrelgtk
from ostrelbase import destroyable
from queue_helpers import check_invariants

A, B, C, D, E, F, G, H = (local(f'{n}.py') for n in 'abcdefgh')
R = remote('r.py')
ADDED, REMOVED = 'scan-queue-locs-added', 'scan-queue-locs-removed'


def install_callback_obj(host, obj):
    host.fAnaMgr._fHelperProcessSupport = SimpleNamespace(fHelperCallbackObj=obj)
    return obj


def helper_calls(host):
    return [(c.args, c.kwargs) for c in host.fLog.find('helper')]


def test_work_recorded_in_a_gone_helper_is_queued_again(coord, host):
    coord._fLocsQueuedInHelper.update({A, B, C})
    host.UseHelper()
    coord._UpdateForHelperProcess()  # the helper still runs: its work stays there
    assert coord._fLocsQueuedInHelper == {A, B, C} and coord._fIdleProcId is None
    host.UseHelper(False)
    assert coord._UpdateForHelperProcess() is None
    assert coord._fLocsQueuedInHelper == set()
    assert queued(coord) == {(loc, '*', PRIMARY): 2 for loc in (A, B, C)}
    assert len(pending_callbacks(coord)) == 1 and host.fLog == []
    coord._CancelIdle()
    install_callback_obj(host, None)
    coord._UpdateForHelperProcess()  # nothing recorded, no callback object: nothing
    assert coord._fIdleProcId is None and coord._fHelperCallbackObjConnected is None


def test_work_taken_back_during_a_scan_gets_the_scans_priority(coord, host):
    X = local('x.py')
    coord._fLocsQueuedInHelper.update({A, B})
    seen = []

    def step(scanner, end_time):
        coord._UpdateForHelperProcess()
        seen.append(dict(queued(coord)))
        return kFinishedScanning

    host.fScanners.Script(PRIMARY_WHOLE, X, [step])
    coord.AddPairsToPrimaryQueue([(X, '*')], priority=0)
    ostrelgtk.idle_remove(coord._fIdleProcId)
    coord._CB_DoIdleAnalysis()
    assert seen == [{(X, '*', PRIMARY): 0, (A, '*', PRIMARY): 0, (B, '*', PRIMARY): 0}]


def test_a_new_helper_takes_the_queued_local_whole_files(coord, host):
    host.fDataCache.fReady.add(R)
    coord.AddPairsToPrimaryQueue([(A, '*'), (H, 'f'), (B, '*'), (R, '*')], priority=2)
    coord.AddPairsToPrimaryQueue([(C, '*'), (D, 'Cls.m'), (D, 'f'), (E, '*')], priority=1)
    coord.AddPairsToPrimaryQueue([(G, '*')], priority=0)
    coord.AddPairsToSecondaryQueue([(F, '*')], priority=1)
    host.fCacheMgr.OpenBuffer(E)
    Callbacks = helper_callback_class()
    obj = install_callback_obj(host, Callbacks())
    host.UseHelper()
    seen = []
    host.fHelper.Probe('AddPairsToPrimaryQueue', lambda pairs, **kw: seen.append(
        {loc for loc, _s, _n in queued(coord)}))
    host.fLog.clear()

    coord._UpdateForHelperProcess()

    # Per primary single queue, in queue order; each left the local queue first.
    assert helper_calls(host) == [(([(G, '*')],), {'priority': 0}),
                                  (([(C, '*')],), {'priority': 1}),
                                  (([(A, '*'), (B, '*')],), {'priority': 2})]
    assert [s & {A, B, C, G} for s in seen] == [{A, B, C}, {A, B}, set()]
    # Scans of other names, other scope lists, remote and open files stay here.
    assert queued(coord) == {(R, '*', PRIMARY): 2, (H, 'f', PRIMARY): 2,
                             (D, 'Cls.m', PRIMARY): 1, (D, 'f', PRIMARY): 1,
                             (E, '*', PRIMARY): 1, (F, '*', DERIVED): 1}
    check_invariants(coord._fScanQueue)
    assert coord._fLocsQueuedInHelper == set() and coord._fHelperCallbackObjConnected is obj
    assert [(signal, type(cb), owner) for signal, cb, owner in Callbacks.fConnects] == [
        (REMOVED, ostrelgtk.NoObjCallback, coord), (ADDED, ostrelgtk.NoObjCallback, coord)]


def test_the_same_callback_object_moves_and_connects_once(coord, host):
    class EqualCallbacks(helper_callback_class()):
        def __eq__(self, other):
            return isinstance(other, EqualCallbacks)

        __hash__ = destroyable.CDestroyable.__hash__

    obj = install_callback_obj(host, EqualCallbacks())
    host.UseHelper()
    coord._UpdateForHelperProcess()
    coord._fScanQueue.AddScanPairs([(B, '*')], PRIMARY, 2)
    install_callback_obj(host, EqualCallbacks())  # another object, but equal
    coord._UpdateForHelperProcess()
    assert helper_calls(host) == [] and queued(coord) == {(B, '*', PRIMARY): 2}
    assert len(EqualCallbacks.fConnects) == 2 and coord._fHelperCallbackObjConnected is obj
    # A different object is a new helper: it gets the work and its own connections.
    Other = helper_callback_class('OtherCallbacks')
    other = install_callback_obj(host, Other())
    coord._UpdateForHelperProcess()
    assert helper_calls(host) == [(([(B, '*')],), {'priority': 2})]
    assert len(Other.fConnects) == 2 and coord._fHelperCallbackObjConnected is other


def test_the_helpers_reports_keep_the_record_of_its_work(coord, host):
    Callbacks = helper_callback_class()
    install_callback_obj(host, Callbacks())
    coord._fLocsQueuedInHelper.add(H)
    coord._UpdateForHelperProcess()  # no proxy: the work stays local
    assert queued(coord) == {(H, '*', PRIMARY): 2}
    reporter = Callbacks()  # any instance of the class reports
    reporter.emit(ADDED, reporter, [A, B])
    reporter.emit(ADDED, reporter, (C,))
    reporter.emit(REMOVED, reporter, [B, C, D])  # D was never recorded
    assert coord._fLocsQueuedInHelper == {A}
    coord.RemoveLocationsFromQueue([H])
    assert coord.QueuesEmpty() is False
    stranger = helper_callback_class('Stranger')()
    stranger.emit(REMOVED, stranger, [A])  # objects of another class are not followed
    assert coord._fLocsQueuedInHelper == {A}
    reporter.emit(REMOVED, reporter, [A])
    assert coord.QueuesEmpty() is True


def test_a_failed_hand_over_is_repeated_by_the_next_call(coord, host):
    Callbacks = helper_callback_class()
    obj = install_callback_obj(host, Callbacks())
    coord.AddPairsToPrimaryQueue([(C, '*')], priority=1)
    coord.AddPairsToPrimaryQueue([(A, '*')], priority=2)
    host.UseHelper()
    host.fHelper.Fail('AddPairsToPrimaryQueue', Boom('helper gone'))
    with pytest.raises(Boom):
        coord._UpdateForHelperProcess()
    assert coord._fHelperCallbackObjConnected is None and Callbacks.fConnects == []
    assert (A, '*', PRIMARY) in queued(coord)  # the later queue was not reached
    host.fHelper.Fail('AddPairsToPrimaryQueue', None)
    coord._UpdateForHelperProcess()
    assert helper_calls(host)[-1] == (([(A, '*')],), {'priority': 2})
    assert queued(coord) == {} and coord._fHelperCallbackObjConnected is obj
    assert len(Callbacks.fConnects) == 2


def test_destroying_the_coordinator_ends_the_class_wide_connections():
    h = Host()
    Callbacks = helper_callback_class()
    install_callback_obj(h, Callbacks())
    h.UseHelper()
    c = make_coord(h)
    h.fAnaMgr.fScanCoordinator = c
    owned = destroyable._debug_owned_count(c)
    c._UpdateForHelperProcess()
    assert destroyable._debug_owned_count(c) == owned + 2
    c.destroy()
    assert destroyable._debug_owned_count(c) == 0
    reporter = Callbacks()
    reporter.emit(ADDED, reporter, [A])
    assert c._fLocsQueuedInHelper == set()
    h.Destroy()
