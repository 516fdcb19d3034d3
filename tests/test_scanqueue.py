"""The scan queue (_CSingleScanQueue and _CScanQueue): what the property tests do
not reach.  Argument handling and its messages, what a failure half-way through
leaves behind, scan names without an order, the listing, the GUI manager,
signal handlers that change the queue, destruction and reference cycles.
"""
import functools
import gc
import weakref

import pytest
import singleton
from doubles import (
    AsyncLocation,
    FakeGuiMgr,
    FakeLocationDataCache,
    LocalLocation,
    OtherDocument,
    make_source_editor,
)
from ostrelbase import location
from queue_helpers import *

pytestmark = pytest.mark.usefixtures('async_probe')

import pysource.scancoordinator as sc

A, B, C, D, V = (LocalLocation(f'{n}.py') for n in ('a', 'b', 'c', 'd', 'visible'))
X, Y = AsyncLocation('x.py'), AsyncLocation('y.py')


def park(q, data_cache, loc, scope, name=S, priority=None, add_to_check=False):
    """Queues a scan of a remote location that is not ready, so it is parked."""
    data_cache.fReady.discard(loc)
    q.AddScanPairs([(loc, scope)], name, priority, add_to_check)


def listing(q, **kwargs):
    out = []
    q.PrintScanQueues(out.append, **kwargs)
    return out


def test_single_queue_construction():
    sq = sc._CSingleScanQueue(order=-3, priority=True, scan_name='scan')
    assert (sq.fScanName, sq.fPriority, sq.fOrder, len(sq.fOrderedDict)) == ('scan', 1, -3, 0)
    assert type(sq.fPriority) is int
    for args, exc, message in [
            (('scan', 2), TypeError,
             r'^__init__\(\) takes exactly 3 positional arguments \(2 given\)$'),
            (('scan', 2, 0, 0), TypeError, r'\(4 given\)$'),
            (('scan', '2', 0), TypeError, None),
            (('scan', 2, 1.5), TypeError, None),
            (('scan', 2 ** 64, 0), OverflowError, None)]:
        with pytest.raises(exc, match=message):
            sc._CSingleScanQueue(*args)
    with pytest.raises(TypeError, match=r"^__init__\(\) got an unexpected keyword argument 'x'$"):
        sc._CSingleScanQueue('scan', 2, 0, x=1)
    with pytest.raises(TypeError, match=r"got multiple values for keyword argument 'order'$"):
        sc._CSingleScanQueue('scan', 2, 0, order=1)


@pytest.mark.parametrize('bad, exc, message', [
    ([A, 'x'], TypeError, 'Expected tuple, got list'),
    (None, TypeError, "'NoneType' object is not iterable"),
    ((A, 'x', 'y'), ValueError, r'too many values to unpack \(expected 2\)'),
    ((A,), ValueError, r'not enough values to unpack \(expected 2, got 1\)'),
])
def test_a_bad_pair_keeps_the_pairs_before_it(queue, bad, exc, message):
    queue.AddScanPairs([(C, 'kept')], S, 1)
    with pytest.raises(exc, match=f'^{message}$'):
        queue.AddScanPairs([(X, 'parked'), (B, 'b'), bad, (D, 'd')], S, add_to_check=True)
    check_invariants(queue)
    assert queued_scans(queue) == {(C, 'kept', S): 1, (B, 'b', S): 2}
    assert parked(queue) == {X: ({(X, 'parked', S, 2)}, 2)}
    assert queue._fWholeFilesToCheck == {B: 2}


def test_bad_arguments_change_nothing(queue):
    queue.AddScanPairs([(A, 'kept')], S)
    before = snapshot(queue)
    for call, exc, message in [
            (lambda: queue.AddScanPairs([(A, 'f')], S, '1'), TypeError, None),
            (lambda: queue.SetScansToOrder([]), TypeError, '^Expected dict, got list$'),
            (lambda: queue.RemoveScanTriple((A, 'kept')), ValueError, None),
            (lambda: queue.PopWholeFilesToCheck('1'), TypeError, None),
            (lambda: queue.First(1), TypeError,
             r'^First\(\) takes exactly 0 positional arguments \(1 given\)$')]:
        with pytest.raises(exc, match=message):
            call()
    for name in ('Clear', '_destroy_impl', 'GetWaitingCount', '_CB_ActiveDocChanged',
                 '_SignalEmitIdle'):
        with pytest.raises(TypeError, match=rf'^{name}\(\) takes exactly 0 positional'):
            getattr(queue, name)(1)
    assert snapshot(queue) == before


def test_uninitialised_queue_reports_itself(data_cache):
    q = sc._CScanQueue.__new__(sc._CScanQueue)
    with pytest.raises(RuntimeError, match=r'^_CScanQueue.__init__\(\) has not been called$'):
        q.Empty()


def test_a_failing_host_call_keeps_the_pairs_read_before(queue, monkeypatch):
    boom = LocalLocation('boom.py')

    def is_async(loc):
        if loc == boom:
            raise KeyError('no such server')
        return loc.kAsync

    monkeypatch.setattr(location, 'IsAsyncInspectLocation', is_async)
    with pytest.raises(KeyError, match='no such server'):
        queue.AddScanPairs([(A, 'a'), (boom, 'b'), (C, 'c')], S)
    assert queued_scans(queue) == {(A, 'a', S): 2}
    check_invariants(queue)


def test_a_failing_readiness_check_propagates(queue, data_cache):
    data_cache.fReady.add(X)
    queue.AddScanPairs([(X, 'f'), (A, 'f')], S)
    before = snapshot(queue)

    def failing(loc, flag):
        raise OSError('inspection service gone')

    data_cache.TreeBranchReady = failing
    with pytest.raises(OSError):
        queue.First()
    assert snapshot(queue) == before


def test_name_without_order_sorts_as_order_zero(data_cache, capsys):
    q = make_queue(load_impl('compiled'), data_cache, orders={S: -1, T: 1})
    for name in (T, 'other', S):
        q.AddScanPairs([(A, 'f')], name)
    assert [(sq.fScanName, sq.fOrder) for sq in q._fOrderedQueues] == [
        (S, -1), ('other', 0), (T, 1)]
    out = capsys.readouterr().out
    assert 'Scan without order: other\n' in out and f'without order: {S}' not in out
    q.SetScansToOrder(None)
    q.AddScanPairs([(B, 'f')], T, 0)
    assert (q._fOrderedQueues[0].fPriority, q._fOrderedQueues[0].fOrder) == (0, 0)
    q.destroy()


def test_moving_scans_between_single_queues(queue):
    class Scope(str):  # compared through Python, not as exact str
        pass

    queue.AddScanPairs([(A, Scope('c')), (A, 'a'), (A, Scope('b'))], S)
    first, second = queue._fOrderedQueues[0], queue._GetSingleQueue(S, 1)
    assert first.fOrderedDict.get(A) == ['a', 'b', 'c']
    queue._MoveScansBetweenQueues(A, None, second, first)  # nothing of A there to move
    queue._MoveScansBetweenQueues(A, ['a', 'b', 'c'], first, second)
    assert queued_scans(queue) == {(A, n, S): 1 for n in 'abc'}
    second.fOrderedDict.Set(A, ('a',), True)
    with pytest.raises(TypeError, match='^Expected list, got tuple$'):
        queue._MoveScansBetweenQueues(A, ['a'], second, first)


def test_totals_that_disagree_with_the_scans_are_reported(queue):
    queue.AddScanPairs([(A, 'f')], S)
    del queue._fPerScanNameCounts[S]
    with pytest.raises(AssertionError):
        queue.RemoveScanTriple((A, 'f', S))


def test_scan_names_of_one_order_share_a_single_queue(data_cache):
    q = make_queue(load_impl('compiled'), data_cache, orders={S: 0, T: 0})
    q.AddScanPairs([(A, 'b')], S)
    q.AddScanPairs([(A, 'a'), (A, 'b')], T)
    [sq] = q._fOrderedQueues
    assert sq.fScanName == S and sq.fOrderedDict.get(A) == ['a', 'b']
    # (b, T) found 'b' already listed: skipped, not recorded.
    assert dict(q.GetPendingDictForLoc(A)) == {('b', S): 2, ('a', T): 2}
    assert q.First() == (A, 'a', S, 2)
    q.destroy()


def test_priority_of_a_parked_location(queue, data_cache):
    park(queue, data_cache, X, 'f', priority=3)
    assert queue._FindScanPriority(X, 'anything', T) == 3
    data_cache.fReady.add(Y)
    queue.AddScanPairs([(Y, 'e')], S, 3, add_to_check=True)
    queue.AddScanPairs([(Y, 'e'), (Y, 'g')], S, 1)
    data_cache.MakeUnready([Y])
    queue.PopWholeFilesToCheck()
    # Parked by a whole-file check: its priority answers for every scan of the file.
    assert queue._FindScanPriority(Y, 'g', S) == 3
    assert queue.GetPendingDictForLoc(Y) is None


def test_remove_can_leave_parked_work_alone(queue, data_cache):
    park(queue, data_cache, X, 'f')
    assert queue.RemoveScanTriple((X, 'f', S), remove_waiting=False) is False
    queue.RemoveAllForLocations([X], remove_waiting=False)
    assert set(parked(queue)) == {X}
    assert queue.RemoveScanTriple((X, 'g', S), 2) is True  # with a priority: the exact item
    assert queue.RemoveScanTriple((X, 'f', S)) is True
    assert parked(queue) == {}


def test_completed_ready_scan_leaves_the_queue_while_other_work_is_parked(impl, data_cache):
    q = make_queue(impl, data_cache)
    data_cache.fReady.add(X)
    q.AddScanPairs([(X, 'a'), (X, 'c')], T, 1)
    data_cache.MakeUnready([X])
    q.AddScanPairs([(X, 'b')], S)
    waiting = dict(q._fWaitingForInspectByLoc)
    data_cache.fReady.add(X)  # ready again; the release has not arrived yet
    assert q.First() == (X, 'a', T, 1)
    q.ScanCompleted(impl.CScanItem(X, 'a', T, 1))
    assert q.First() == (X, 'c', T, 1)
    assert q._fWaitingForInspectByLoc == waiting
    # Without a priority the matching ready scan is found and removed as well.
    assert q.RemoveScanTriple((X, 'c', T)) is True
    assert not q.LocationInQueue(X) and q._fWaitingForInspectByLoc == waiting
    check_invariants(q)
    q.destroy()


def test_readiness_is_asked_only_once_a_remote_file_was_seen(queue, data_cache, async_probe):
    queue.AddScanPairs([(A, 'f'), (B, 'f')], S)
    assert async_probe.fCalls == [A, B] and data_cache.fCalls == []
    assert queue.IsTreeBranchReady(X) is True
    data_cache.fReady.add(Y)
    queue.AddScanPairs([(X, 'f'), (B, 'g'), (Y, 'f')], S)
    assert queue.fAnyAsyncInspectLocation is True
    assert async_probe.fCalls == [A, B, X, X, B, Y]
    assert data_cache.AskedAbout() == [X, Y]
    assert queue.IsTreeBranchReady(X) is False


def test_listing(queue, data_cache, capsys):
    queue.AddScanPairs([(A, 'b'), (A, 'a'), (B, '*')], S, 2)
    queue.AddScanPairs([(C, 'x')], T, 1)
    queue.AddScanPairs([(D, 'q')], S, 3)
    queue.RemoveScanTriple((D, 'q', S))
    full = [' Scan queue for derived; priority=1 count=1\n', f'  {C!r}\n', '    x\n',
            ' Scan queue for primary; priority=2 count=2\n', f'  {A!r}\n', '    a\n',
            '    b\n', f'  {B!r}\n', '    *\n', ' Scan queue for primary; priority=3 count=0\n']
    assert listing(queue) == ['_CScanQueue contents:\n', *full]
    assert listing(queue, limit=3)[4:] == [
        full[3], full[4], '    ...\n', '  ...\n', full[-1], '  ...\n']
    capsys.readouterr()
    queue.PrintScanQueues()  # to standard output by default
    assert capsys.readouterr().out == ''.join(listing(queue))

    queue.Clear()
    park(queue, data_cache, X, 'f')
    park(queue, data_cache, Y, 'f')
    item = sc.CScanItem(A, 'f', S, 2)
    queue.StartWaitingForData(item)
    assert listing(queue, limit=1) == [
        '_CScanQueue contents:\n', 'Waiting for 2 remote files to be inspected',
        f'  File: {X!r}\n', '  ...\n', 'Waiting for remote on 1 scans\n',
        f'  Scan: {item!r}\n', '  ...\n']


def test_handler_changes_go_to_a_new_emission(queue, signals):
    seen = []

    def on_added(q, added):
        q.RemoveAllForLocations(added)
        seen.append((q._fSignalEmitIdle is not None, set(q._fPendingLocationsRemoved)))

    queue.connect('locations-added', on_added)
    queue.AddScanPairs([(A, 'f')], S)
    run_idles()
    assert seen == [(True, {A})]
    assert signals.fEmitted == [('locations-added', (queue, {A})),
                                ('locations-removed', (queue, {A}))]


def test_update_pending_sets_directly(queue, signals):
    queue._UpdatePendingSets(None, None)
    queue._UpdatePendingSets({A, B}, None)
    queue._UpdatePendingSets(set(), {B, C})
    queue._UpdatePendingSets({C, D}, set())
    assert queue._SignalEmitIdle() is None and queue._fSignalEmitIdle is None
    assert signals.fEmitted == [('locations-added', (queue, {A, B, D})),
                                ('locations-removed', (queue, {B}))]


def test_the_gui_managers_documents_are_promoted(queue):
    gui = FakeGuiMgr(active=make_source_editor(A), visible=[V])
    singleton.GetSingletons().Set('fGuiMgr', gui)
    assert queue._fGuiMgr is gui
    queue.AddScanPairs([(A, 'f'), (V, 'f'), (B, 'f')], S, 2)
    gui.emit('active-document-changed')
    assert gui.fCalls == [('GetActiveDocument',), ('GetDocuments', True, False)]
    assert queued_scans(queue) == {(A, 'f', S): 1, (V, 'f', S): 1, (B, 'f', S): 2}
    gui.fActive, gui.fCalls = OtherDocument(), []
    gui.emit('active-document-changed')
    assert gui.fCalls == [('GetActiveDocument',)]  # not a source editor: ignored
    gui.destroy()


def test_clear_destroys_the_old_single_queues(queue, data_cache):
    queue.AddScanPairs([(A, 'f')], S)
    old = queue._fOrderedQueues[0]
    queue.Clear()
    assert old._CDestroyable__fDestroyed and queue._fOrderedQueues == []


def test_destroy_cancels_the_emission_and_disconnects(data_cache):
    calls = []

    class Recording(sc._CScanQueue):
        def _CB_TreeBranchesNowReady(self, data, ready_set):
            calls.append(set(ready_set))
            return super()._CB_TreeBranchesNowReady(data, ready_set)

    q = make_queue(load_impl('compiled'), data_cache, cls=Recording)
    emitted = []
    q.connect('locations-added', lambda *args: emitted.append(args))
    park(q, data_cache, X, 'f')
    data_cache.MakeReady([Y])
    q.AddScanPairs([(A, 'f')], S)
    q.destroy()
    run_idles()
    data_cache.MakeReady([X])
    assert calls == [{Y}] and emitted == []


def test_destroyed_queue_is_collected_despite_cycles(data_cache):
    q = make_queue(load_impl('compiled'), data_cache)
    gui = FakeGuiMgr()
    singleton.GetSingletons().Set('fGuiMgr', gui)
    q.connect('locations-added', functools.partial(lambda owner, *args: owner.Empty(), q))
    q.AddScanPairs([(A, 'f')], S)
    park(q, data_cache, X, 'f')
    q.StartWaitingForData(sc.CScanItem(A, 'f', S, 2))
    refs = [weakref.ref(q), weakref.ref(q._fOrderedQueues[0])]
    q.destroy()
    del q
    run_idles()
    gc.collect()
    assert [r() for r in refs] == [None, None]
    gui.destroy()


def test_queues_in_cycles_through_their_locations_or_their_class_are_collected(async_probe):
    class Loc(LocalLocation):
        __slots__ = ('queue',)

    cls = type('Queue', (sc._CScanQueue,), {})
    q, loc = cls(FakeLocationDataCache()), Loc('a.py')
    q.SetScansToOrder({S: 0})
    loc.queue, cls.instance = q, q  # queue -> loc -> queue; queue -> class -> queue
    q.AddScanPairs([(loc, 'f')], S)
    q.UpdateForVisibleDocuments(loc, [])
    cache = q._fLocationDataCache
    singleton.ResetSingletons()  # the emitters it listens to go; it is never destroyed
    cache.destroy()
    run_idles()
    async_probe.fCalls.clear()
    refs = [weakref.ref(q), weakref.ref(cls)]
    del q, loc, cls, cache
    gc.collect()
    assert [r() for r in refs] == [None, None]


def test_parked_items_iterate_as_in_the_reference(data_cache):
    """Parked work is re-queued in the iteration order of its item set, and that order
    decides which of two conflicting scans survives; string hashes vary per process,
    so the scenario runs over many file names."""
    def scenario(q, loc):
        for scope, priority, check in [('*', 2, False), ('a', 2, False), ('b', 3, True),
                                       ('*', 0, False)]:
            park(q, data_cache, loc, scope, T, priority, check)
        q.RemoveScanTriple((loc, '*', T))
        park(q, data_cache, loc, '*', T, 0)
        park(q, data_cache, loc, 'c', T, 1, add_to_check=True)
        order = [tuple(i) for i in q._fWaitingForInspectByLoc[loc][0]]
        data_cache.MakeReady([loc])
        return order, snapshot(q)

    for i in range(100):
        loc = AsyncLocation(f'pkg/mod{i}.py')
        results = []
        for name in ('compiled', 'reference'):
            q = make_queue(load_impl(name), data_cache)
            results.append(scenario(q, loc))
            q.destroy()
        assert results[0] == results[1], loc
