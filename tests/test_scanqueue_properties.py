"""Property-based tests of the scan queue: random operations, host signals and
main-loop runs on the compiled queue and the reference queue side by side; both
must agree, the invariants must hold after every step, and each operation must
keep its promise.  SCANQUEUE_PROPERTY_EXAMPLES (e.g. 2000) searches longer."""
import os

import pytest
import singleton
from doubles import AsyncLocation, FakeLocationDataCache, LocalLocation, SignalRecorder
from guiutils import ostrelgtk
from hypothesis import HealthCheck, assume, given, settings
from hypothesis import strategies as st
from hypothesis.stateful import (
    RuleBasedStateMachine,
    initialize,
    invariant,
    precondition,
    rule,
    run_state_machine_as_test,
)
from queue_helpers import *

import pysource.scancoordinator as sc

pytestmark = pytest.mark.usefixtures('async_probe')

kExamples = int(os.environ.get('SCANQUEUE_PROPERTY_EXAMPLES', '0')) or None

kLocal = [LocalLocation(f'l{i}.py') for i in range(3)]
kAsync = [AsyncLocation(f'r{i}.py') for i in range(3)]
kLocs = kLocal + kAsync
kScopes = ['*', 'a', 'b', 'c']
kNames = [S, T]

locs = st.sampled_from(kLocs)
scopes = st.sampled_from(kScopes)
names = st.sampled_from(kNames)
priorities = st.integers(min_value=0, max_value=3)
pairs = st.lists(st.tuples(locs, scopes), min_size=0, max_size=6)


def _machine_settings(examples, steps):
    return settings(max_examples=kExamples or examples,
                    stateful_step_count=steps if kExamples is None else max(steps, 60),
                    deadline=None,
                    suppress_health_check=[HealthCheck.too_slow,
                                           HealthCheck.function_scoped_fixture])


def _outcome(fn, *args, **kwargs):
    """A call's result, or the type of the exception it raised."""
    try:
        return ('ok', fn(*args, **kwargs))
    except Exception as exc:  # noqa: BLE001 - any exception is an outcome to compare
        return ('raised', type(exc).__name__)


class QueueMachine(RuleBasedStateMachine):
    """The compiled queue under test, and the reference queue that must agree with it
    step by step."""

    def __init__(self):
        super().__init__()
        ostrelgtk.reset()
        singleton.ResetSingletons()
        self.cache = FakeLocationDataCache()
        self.impls = [load_impl('compiled'), load_impl('reference')]
        self.queues = [make_queue(impl, self.cache) for impl in self.impls]
        self.recorders = [SignalRecorder(q, ('locations-added', 'locations-removed'))
                          for q in self.queues]
        self.present_at_emission = set()
        self.touched = set()
        self.present = set()
        self.docs = (None, frozenset())

    def teardown(self):
        for q in self.queues:
            q.destroy()
        self.cache.destroy()
        ostrelgtk.reset()
        singleton.ResetSingletons()

    @property
    def q(self):
        return self.queues[0]

    def each(self, fn):
        """Runs fn(queue, impl) on both implementations; they must agree."""
        outcomes = [_outcome(fn, q, impl) for q, impl in zip(self.queues, self.impls)]
        assert outcomes[1] == outcomes[0], f'implementations disagree: {outcomes}'
        kind, value = outcomes[0]
        assert kind == 'ok', f'unexpected exception {value}'
        return value

    def stale(self, loc):
        """Queued while ready, but no longer ready: work added now would be parked
        beside its queued scans, which the queue does not guard against."""
        return (self.q.fAnyAsyncInspectLocation and loc.kAsync and loc not in self.cache.fReady
                and loc in self.q._fPerLocationInfo)

    def ready_scans(self):
        return sorted(queued_scans(self.q).items(), key=repr)

    def known_scans(self):
        known = [(*key, p) for key, p in self.ready_scans()]
        for items, _ in self.q._fWaitingForInspectByLoc.values():
            known.extend(tuple(i) for i in items)
        return sorted(known, key=repr)

    @initialize(ready=st.sets(st.sampled_from(kAsync)))
    def start_ready(self, ready):
        self.cache.fReady.update(ready)

    # Adding has three rules so that the queue fills up between the removals.
    @rule(pair_list=pairs, name=names, priority=st.one_of(st.none(), priorities),
          check=st.booleans())
    def add_scan_pairs(self, pair_list, name, priority, check):
        pair_list = [p for p in pair_list if not self.stale(p[0])]
        self.each(lambda q, impl: q.AddScanPairs(list(pair_list), name, priority, check))

    @rule(pair_list=st.lists(st.tuples(st.sampled_from(kAsync), scopes), min_size=1,
                             max_size=4),
          name=names, priority=priorities, check=st.booleans())
    def add_remote_scan_pairs(self, pair_list, name, priority, check):
        self.add_scan_pairs(pair_list, name, priority, check)

    @rule(loc=locs, scope_list=st.lists(scopes, min_size=1, max_size=4), name=names,
          priority=priorities)
    def add_scopes_of_one_file(self, loc, scope_list, name, priority):
        self.add_scan_pairs([(loc, scope) for scope in scope_list], name, priority, False)

    @rule(loc=locs, scope=scopes, name=names, priority=st.one_of(st.none(), priorities))
    def remove_scan_triple(self, loc, scope, name, priority):
        queued = queued_scans(self.q).get((loc, scope, name))
        removed = self.each(lambda q, impl: q.RemoveScanTriple((loc, scope, name), priority))
        if queued is not None and priority in (None, queued):
            assert removed is True and (loc, scope, name) not in queued_scans(self.q)

    @rule(loc_list=st.lists(locs, max_size=3),
          name_set=st.one_of(st.none(), st.sets(names)))
    def remove_all_for_locations(self, loc_list, name_set):
        self.each(lambda q, impl: q.RemoveAllForLocations(list(loc_list), name_set))
        assert not any(loc in loc_list and (name_set is None or name in name_set)
                       for loc, _scope, name in queued_scans(self.q))

    def first(self):
        item = self.each(lambda q, impl: tuple(q.First()))
        loc, scope, name, priority = item
        ready = queued_scans(self.q)
        if loc is None:
            assert not ready, 'First() found nothing though scans are queued'
            return item
        # The first scan: lowest (priority, scan order), first location of its single
        # queue, first name of that location; First() takes nothing out.
        assert ready[(loc, scope, name)] == priority
        for (l, s, n), p in ready.items():
            assert (p, kOrders[n]) >= (priority, kOrders[name]), (l, s, n, p, item)
            if (l, n, p) == (loc, name, priority):
                assert s >= scope
        sq = next(sq for sq in self.q._fOrderedQueues if (sq.fPriority, sq.fScanName) == (
            priority, name))
        assert sq.fOrderedDict._fFirst.key == loc
        return item

    @rule()
    def first_only(self):
        self.first()

    @rule()
    def complete_first(self):
        item = self.first()
        if item[0] is not None:
            self.complete(*item)

    @rule(loc=locs, scope=scopes, name=names, priority=priorities)
    def complete(self, loc, scope, name, priority):
        before = self.q.GetScanCount(sc.CScanItem(loc, scope, name, None))
        self.each(lambda q, impl: q.ScanCompleted(impl.CScanItem(loc, scope, name, priority)))
        assert self.q.GetScanCount(sc.CScanItem(loc, scope, name, None)) == before + 1

    @rule(max_files=st.one_of(st.none(), st.integers(min_value=0, max_value=3)))
    def pop_whole_files(self, max_files):
        waiting = list(self.q._fWholeFilesToCheck.items())
        if max_files is None:
            result = self.each(lambda q, impl: q.PopWholeFilesToCheck())
        else:
            result = self.each(lambda q, impl: q.PopWholeFilesToCheck(max_files))
        # Up to max_files + 1 files, the most recently added first; files that are not
        # ready are not returned (their scans are parked).
        taken = waiting[::-1][:(25 if max_files is None else max_files) + 1]
        assert (result is None) is (not waiting)
        assert result in (None, [pair for pair in taken if pair in result])
        assert all(pair in (result or ()) or (pair[0].kAsync and pair[0] not in self.cache.fReady)
                   for pair in taken)
        assert list(self.q._fWholeFilesToCheck.items()) == waiting[:len(waiting) - len(taken)]

    @rule(active=st.one_of(st.none(), locs), visible=st.lists(locs, max_size=3))
    def update_visible(self, active, visible):
        docs = (active, frozenset(visible) | {active} - {None})
        self.each(lambda q, impl: q.UpdateForVisibleDocuments(active, list(visible)))
        if docs != self.docs:  # new documents: their background work is promoted
            assert not any(loc in docs[1] and p >= 2 for (loc, _s, _n), p in
                           queued_scans(self.q).items())
        self.docs = docs

    @rule(data=st.data())
    def start_waiting_for_data(self, data):
        candidates = self.ready_scans()
        if candidates and data.draw(st.booleans(), label='queued scan'):
            (loc, scope, name), priority = data.draw(st.sampled_from(candidates))
        else:
            loc, scope, name, priority = data.draw(st.tuples(locs, scopes, names, priorities))
        self.each(lambda q, impl: q.StartWaitingForData(impl.CScanItem(loc, scope, name,
                                                                       priority)))
        assert (loc, scope, name, priority) in {tuple(i) for i in
                                                self.q._fScanItemsWaitingForData}

    @precondition(lambda self: self.q._fScanItemsWaitingForData)
    @rule(data=st.data())
    def finished_waiting_for_data(self, data):
        item = data.draw(st.sampled_from(sorted(map(tuple, self.q._fScanItemsWaitingForData),
                                                key=repr)))
        assume(not self.stale(item[0]))
        self.each(lambda q, impl: q.FinishedWaitingForData(impl.CScanItem(*item)))

    @rule(now_ready=st.sets(st.sampled_from(kAsync), min_size=1))
    def tree_branches_ready(self, now_ready):
        self.cache.fReady.update(now_ready)
        self.cache.emit('now-tree-branch-ready', None, now_ready)
        assert not set(self.q._fWaitingForInspectByLoc) & now_ready

    @rule(loc=st.sampled_from(kAsync))
    def location_data_lost(self, loc):
        self.cache.MakeUnready([loc])

    # Rules aimed at what is queued or parked, to reach the interesting paths often.

    @precondition(lambda self: self.q._fPerLocationInfo or self.q._fWaitingForInspectByLoc)
    @rule(data=st.data(), with_priority=st.booleans())
    def remove_known_scan(self, data, with_priority):
        loc, scope, name, priority = data.draw(st.sampled_from(self.known_scans()))
        self.remove_scan_triple(loc, scope, name, priority if with_priority else None)

    @precondition(lambda self: any(loc.kAsync for loc in self.q._fPerLocationInfo))
    @rule(data=st.data())
    def lose_data_of_queued_file(self, data):
        queued = sorted((loc for loc in self.q._fPerLocationInfo if loc.kAsync), key=repr)
        self.location_data_lost(data.draw(st.sampled_from(queued)))

    @precondition(lambda self: self.q._fWaitingForInspectByLoc)
    @rule(data=st.data())
    def parked_files_become_ready(self, data):
        parked = sorted(self.q._fWaitingForInspectByLoc, key=repr)
        chosen = data.draw(st.sets(st.sampled_from(parked), min_size=1))
        self.tree_branches_ready(chosen | data.draw(st.sets(st.sampled_from(kAsync))))

    @precondition(lambda self: self.q._fPerLocationInfo)
    @rule(data=st.data(), visible=st.lists(locs, max_size=2))
    def focus_queued_file(self, data, visible):
        queued = sorted(self.q._fPerLocationInfo, key=repr)
        self.update_visible(data.draw(st.sampled_from(queued)), visible)

    @rule(dice=st.integers(min_value=0, max_value=5))
    def clear(self, dice):
        if dice:  # rarely: it empties everything
            return
        self.each(lambda q, impl: q.Clear())
        assert not self.q._fPerLocationInfo and not self.q._fWaitingForInspectByLoc

    @rule()
    def run_main_loop(self):
        for recorder in self.recorders:
            recorder.Clear()
        assert ostrelgtk.run_until_idle(max_iterations=100)
        emitted = [[(signal, args[0] is q, args[1]) for signal, args in r.fEmitted]
                   for q, r in zip(self.queues, self.recorders)]
        assert emitted[1] == emitted[0]
        # A location whose presence changed since the last emission is announced as
        # added unless it was there at that emission, and as removed unless it is
        # there now: so came-and-went is in both, went-and-came-back in neither.
        now, start = self.present, self.present_at_emission
        expected = []
        if self.touched - start:
            expected.append(('locations-added', True, self.touched - start))
        if self.touched - now:
            expected.append(('locations-removed', True, self.touched - now))
        assert emitted[0] == expected
        self.present_at_emission = set(now)
        self.touched = set()

    @rule()
    def queries(self):
        def ask(q, impl):
            out = []
            q.PrintScanQueues(out.append, limit=5)
            return (q.Empty(), q.Empty(False), q.GetWaitingCount(),
                    [q.GetFileCount(n, p) for n in (None, S, T) for p in (None, 0, 1, 2, 3)],
                    [q.LocationInQueue(loc, n) for loc in kLocs for n in (None, S, T)],
                    [q.GetScanCount(impl.CScanItem(loc, s, S, 1))
                     for loc in kLocs for s in ('*', 'a')],
                    out)
        self.each(ask)

    @invariant()
    def consistent(self):
        for q in self.queues:
            check_invariants(q)
        assert snapshot(self.queues[1]) == snapshot(self.q)
        present = set(self.q._fPerLocationInfo)
        self.touched |= present ^ self.present
        self.present = present


def test_queue_keeps_its_invariants_and_agrees_with_the_reference():
    run_state_machine_as_test(QueueMachine, settings=_machine_settings(500, 50))


# Deferred signals


kSignalLocs = [LocalLocation(f's{i}.py') for i in range(4)]
signal_ops = st.lists(st.one_of(
    st.tuples(st.just('add'), st.sampled_from(kSignalLocs), st.sampled_from(['a', 'b'])),
    st.tuples(st.just('remove'), st.sampled_from(kSignalLocs), st.sampled_from(['a', 'b'])),
    st.tuples(st.just('promote'), st.sampled_from(kSignalLocs), st.just('a')),
    st.tuples(st.just('remove-all'), st.sampled_from(kSignalLocs), st.none()),
    st.tuples(st.just('clear'), st.none(), st.none()),
    st.tuples(st.just('idle'), st.none(), st.none()),
), max_size=30)


@settings(max_examples=kExamples or 150, deadline=None,
          suppress_health_check=[HealthCheck.function_scoped_fixture])
@given(ops=signal_ops)
def test_deferred_signals(impl, data_cache, ops):
    """Per emission: a location that gained work is announced as added, one that lost
    it as removed, one that came and went in both, one that went and came back in
    neither; added comes first; one emission per idle run at most."""
    ostrelgtk.reset()
    q = make_queue(impl, data_cache)
    recorder = SignalRecorder(q, ('locations-added', 'locations-removed'))
    try:
        start = set()
        touched = set()

        def emit_and_check():
            now = set(q._fPerLocationInfo)
            recorder.Clear()
            scheduled = q._fSignalEmitIdle is not None
            assert ostrelgtk.run_until_idle(max_iterations=10)
            expected = []
            if touched - start:
                expected.append(('locations-added', (q, touched - start)))
            if touched - now:
                expected.append(('locations-removed', (q, touched - now)))
            assert recorder.fEmitted == expected
            assert scheduled or not expected
            assert q._fSignalEmitIdle is None
            assert q._fPendingLocationsAdded == set() == q._fPendingLocationsRemoved
            return now

        for op, loc, scope in [*ops, ('idle', None, None)]:
            before = set(q._fPerLocationInfo)
            if op == 'add':
                q.AddScanPairs([(loc, scope)], S, 2)
            elif op == 'remove':
                q.RemoveScanTriple((loc, scope, S))
            elif op == 'promote':
                q.AddScanPairs([(loc, scope)], S, 2)
                q.AddScanPairs([(loc, scope)], S, 1)
            elif op == 'remove-all':
                q.RemoveAllForLocations([loc])
            elif op == 'clear':
                q.Clear()
            else:
                start, touched = emit_and_check(), set()
                continue
            after = set(q._fPerLocationInfo)
            touched |= before ^ after
            assert q._fSignalEmitIdle is not None or before == after
            assert ostrelgtk.GetMainLoop().source_count() <= 1
    finally:
        q.destroy()
