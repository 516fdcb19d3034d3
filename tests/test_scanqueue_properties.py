"""Property-based tests of the scan queue.

`QueueMachine` drives random sequences of queue operations, host signals and
main-loop runs.  After every step it checks, by reading the queue's fields,
the structural invariants and that the queued, parked and waiting scans are
exactly those a small model predicts.  It runs the compiled queue beside the
pure-Python reference queue and checks that both give equal results, fields
and signals for the same operations.

The default run is kept short; set SCANQUEUE_PROPERTY_EXAMPLES (for example
to 2000) for a longer search.
"""
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


class QueueModel:
    """What should be queued, independently of how the queue stores it.

    ready:   (loc, scope, scan name) -> priority of every ready-queued scan
    parked:  loc -> (set of (loc, scope, scan name, priority), check priority)
    data:    set of (loc, scope, scan name, priority) waiting for data
    whole:   loc -> priority of whole files to check, in insertion order
    """

    def __init__(self, cache):
        self.cache = cache
        self.ready = {}
        self.parked = {}
        self.data = set()
        self.whole = {}
        self.completed = {}
        self.any_async = False
        self.active = None
        self.visible = set()

    # -- readiness ---------------------------------------------------------

    def is_ready(self, loc):
        return not (self.any_async and loc.kAsync and loc not in self.cache.fReady)

    def has_ready(self, loc):
        return any(key[0] == loc for key in self.ready)

    def stale(self, loc):
        """Queued while ready, but no longer ready: work added now would be parked
        beside its queued scans, which the queue does not guard against."""
        return not self.is_ready(loc) and self.has_ready(loc)

    # -- adding and removing -----------------------------------------------

    def find(self, loc, scope, name, order_source):
        if self.has_ready(loc):
            return self.ready.get((loc, scope, name))
        entry = self.parked.get(loc)
        if entry is None:
            return None
        if entry[1] is not None:
            return entry[1]
        # The first item the queue's own set yields.
        for item in order_source._fWaitingForInspectByLoc[loc][0]:
            return item.priority
        return None

    def add(self, pair_list, name, priority, check, order_source):
        if priority is None:
            priority = 2
        ready_list = []
        for loc, scope in pair_list:
            if loc.kAsync:
                self.any_async = True
            if self.is_ready(loc):
                ready_list.append((loc, scope))
            else:
                items, old_check = self.parked.get(loc, (set(), None))
                items.add((loc, scope, name, priority))
                self.parked[loc] = (items, priority if check else old_check)
        self.add_ready(ready_list, name, priority, check, order_source)

    def add_ready(self, pair_list, name, priority, check, order_source):
        for loc, scope in pair_list:
            existing = self.find(loc, scope, name, order_source)
            if existing is not None:
                if existing <= priority:
                    continue
                self.remove(loc, scope, name, existing)
            if scope != '*':
                whole = self.find(loc, '*', name, order_source)
                if whole is not None and whole <= priority:
                    continue
            if scope == '*':
                for key, p in list(self.ready.items()):
                    if key[0] == loc and key[2] == name and p == priority:
                        del self.ready[key]
            self.ready[(loc, scope, name)] = priority
            if check:
                self.whole[loc] = priority

    def remove(self, loc, scope, name, priority=None):
        if loc in self.parked:
            items, _ = self.parked[loc]
            if priority is not None:
                gone = [(loc, scope, name, priority)]
            else:
                gone = [i for i in items if i[1] == scope and i[2] == name]
            items.difference_update(gone)
            if not items:
                del self.parked[loc]
            return bool(gone)
        if priority is None:
            priority = self.ready.get((loc, scope, name))
        if priority is None or self.ready.get((loc, scope, name)) != priority:
            return False
        del self.ready[(loc, scope, name)]
        return True

    def remove_all(self, loc_list, name_set):
        for loc in loc_list:
            kept = False
            for (l, scope, name), p in list(self.ready.items()):
                if l != loc:
                    continue
                if name_set is None or name in name_set:
                    self.remove(loc, scope, name, p)
                else:
                    kept = True
            if not kept:
                self.parked.pop(loc, None)

    def park(self, loc, check=None):
        keys = [key for key in self.ready if key[0] == loc]
        if not keys:
            return
        if check is None:
            check = self.whole.get(loc)
        items, _ = self.parked.get(loc, (set(), None))
        items.update((loc, scope, name, self.ready.pop((l, scope, name)))
                     for (l, scope, name) in keys)
        self.parked[loc] = (items, check)

    def unpark(self, ready_set, order_source):
        """The ready signal, grouped in the order the queue's own tables iterate."""
        groups = {}
        for loc in ready_set.intersection(order_source._fWaitingForInspectByLoc):
            self.parked.pop(loc)
            items, check = order_source._fWaitingForInspectByLoc[loc]
            for item in items:
                key = (item.scan_name, item.priority, check is not None)
                groups.setdefault(key, []).append((item.loc, item.scope_name))
        for (name, priority, check), pair_list in groups.items():
            self.add_ready(pair_list, name, priority, check, order_source)

    def promote(self, active, visible_list):
        visible = set(visible_list)
        if active is not None:
            visible.add(active)
        if active == self.active and visible == self.visible:
            return
        self.active, self.visible = active, visible
        for loc in visible | {active}:
            for name in kNames:
                keys = {key: p for key, p in self.ready.items()
                        if key[0] == loc and key[2] == name and p >= 1}
                if not any(p > 1 for p in keys.values()):
                    continue
                scopes = {key[1] for key in keys}
                for key in keys:
                    del self.ready[key]
                for scope in (['*'] if '*' in scopes else scopes):
                    self.ready[(loc, scope, name)] = 1

    def pop_whole(self, max_files):
        if not self.whole:
            return None
        popped = []
        while len(popped) <= max_files and self.whole:
            popped.append(self.whole.popitem())
        if not self.any_async:
            return popped
        result = []
        for loc, priority in popped:
            if self.is_ready(loc):
                result.append((loc, priority))
            else:
                self.park(loc, priority)
        return result

    def clear(self):
        self.ready.clear()
        self.parked.clear()
        self.completed.clear()
        self.whole.clear()
        self.any_async = False

    # -- comparing ---------------------------------------------------------

    def check(self, q):
        queued = {}
        for sq in q._fOrderedQueues:
            for loc, scope_names in sq.fOrderedDict.items():
                for scope in scope_names:
                    queued[(loc, scope, sq.fScanName)] = sq.fPriority
        assert queued == self.ready, 'ready scans differ from the model'
        parked = {loc: ({tuple(i) for i in items}, check)
                  for loc, (items, check) in q._fWaitingForInspectByLoc.items()}
        assert parked == {loc: (set(items), check)
                          for loc, (items, check) in self.parked.items()}
        assert {tuple(i) for i in q._fScanItemsWaitingForData} == self.data
        assert list(q._fWholeFilesToCheck.items()) == list(self.whole.items())
        assert q.fAnyAsyncInspectLocation == self.any_async
        assert {tuple(k)[:3]: v for k, v in q._fCompletedCount.items()} == self.completed


class QueueMachine(RuleBasedStateMachine):
    """The compiled queue under test, and the reference queue that must agree with it
    step by step."""

    impl_names = ('compiled', 'reference')

    def __init__(self):
        super().__init__()
        ostrelgtk.reset()
        singleton.ResetSingletons()
        self.cache = FakeLocationDataCache()
        self.impls = [load_impl(name) for name in self.impl_names]
        self.queues = [make_queue(impl, self.cache) for impl in self.impls]
        self.recorders = [SignalRecorder(q, ('locations-added', 'locations-removed'))
                          for q in self.queues]
        self.model = QueueModel(self.cache)
        self.present_at_emission = set()
        self.touched = set()
        self.present = set()

    def teardown(self):
        for q in self.queues:
            q.destroy()
        self.cache.destroy()
        ostrelgtk.reset()
        singleton.ResetSingletons()

    @property
    def order_source(self):
        return self.queues[-1]

    def each(self, fn):
        """Runs fn(queue, impl) on every implementation; they must agree."""
        outcomes = [_outcome(fn, q, impl) for q, impl in zip(self.queues, self.impls)]
        for other in outcomes[1:]:
            assert other == outcomes[0], f'implementations disagree: {outcomes}'
        kind, value = outcomes[0]
        assert kind == 'ok', f'unexpected exception {value}'
        return value

    # -- rules -------------------------------------------------------------

    @initialize(ready=st.sets(st.sampled_from(kAsync)))
    def start_ready(self, ready):
        self.cache.fReady.update(ready)

    # Adding has three rules so that the queue fills up between the removals.
    @rule(pair_list=pairs, name=names, priority=st.one_of(st.none(), priorities),
          check=st.booleans())
    def add_scan_pairs(self, pair_list, name, priority, check):
        pair_list = [p for p in pair_list if not self.model.stale(p[0])]
        self.model.add(pair_list, name, priority, check, self.order_source)
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
        expected = self.model.remove(loc, scope, name, priority)
        result = self.each(lambda q, impl: q.RemoveScanTriple((loc, scope, name), priority))
        assert result is expected

    @rule(loc_list=st.lists(locs, max_size=3),
          name_set=st.one_of(st.none(), st.sets(names)))
    def remove_all_for_locations(self, loc_list, name_set):
        self.model.remove_all(loc_list, name_set)
        self.each(lambda q, impl: q.RemoveAllForLocations(list(loc_list), name_set))

    def first(self):
        ready_before = dict(self.model.ready)
        item = self.each(lambda q, impl: tuple(q.First()))
        loc, scope, name, priority = item
        parked_now = {l for l in self.order_source._fWaitingForInspectByLoc
                      if l not in self.model.parked}
        for l in parked_now:
            assert self.model.stale(l), f'First() parked {l!r}, which is ready'
            self.model.park(l)
        if loc is None:
            assert not self.model.ready, 'First() found nothing though scans are queued'
            return item
        assert self.model.is_ready(loc) and ready_before[(loc, scope, name)] == priority
        key = (priority, kOrders[name])
        for (l, s, n), p in self.model.ready.items():
            assert (p, kOrders[n]) >= key, f'{(l, s, n, p)} should come before {item}'
            if (l, n, p) == (loc, name, priority):
                assert s >= scope
        return item

    @rule()
    def first_only(self):
        self.first()

    @rule()
    def complete_first(self):
        item = self.first()
        if item[0] is None:
            return
        self.complete(*item)

    @rule(loc=locs, scope=scopes, name=names, priority=priorities)
    def complete(self, loc, scope, name, priority):
        key = (loc, scope, name)
        self.model.completed[key] = self.model.completed.get(key, 0) + 1
        self.model.remove(loc, scope, name, priority)
        self.each(lambda q, impl: q.ScanCompleted(impl.CScanItem(loc, scope, name, priority)))

    @rule(max_files=st.one_of(st.none(), st.integers(min_value=0, max_value=3)))
    def pop_whole_files(self, max_files):
        expected = self.model.pop_whole(25 if max_files is None else max_files)
        if max_files is None:
            result = self.each(lambda q, impl: q.PopWholeFilesToCheck())
        else:
            result = self.each(lambda q, impl: q.PopWholeFilesToCheck(max_files))
        assert result == expected

    @rule(active=st.one_of(st.none(), locs), visible=st.lists(locs, max_size=3))
    def update_visible(self, active, visible):
        self.model.promote(active, visible)
        self.each(lambda q, impl: q.UpdateForVisibleDocuments(active, list(visible)))

    @rule(data=st.data())
    def start_waiting_for_data(self, data):
        candidates = sorted(self.model.ready.items(), key=repr)
        if candidates and data.draw(st.booleans(), label='queued scan'):
            (loc, scope, name), priority = data.draw(st.sampled_from(candidates))
        else:
            loc, scope, name, priority = data.draw(st.tuples(locs, scopes, names, priorities))
        item = (loc, scope, name, priority)
        if item not in self.model.data:
            self.model.remove(loc, scope, name, priority)
            self.model.data.add(item)
        self.each(lambda q, impl: q.StartWaitingForData(impl.CScanItem(*item)))

    @precondition(lambda self: self.model.data)
    @rule(data=st.data())
    def finished_waiting_for_data(self, data):
        item = data.draw(st.sampled_from(sorted(self.model.data, key=repr)))
        assume(not self.model.stale(item[0]))
        self.model.data.discard(item)
        self.model.add([item[:2]], item[2], item[3], False, self.order_source)
        self.each(lambda q, impl: q.FinishedWaitingForData(impl.CScanItem(*item)))

    @rule(now_ready=st.sets(st.sampled_from(kAsync), min_size=1))
    def tree_branches_ready(self, now_ready):
        self.cache.fReady.update(now_ready)
        # The model reads the iteration order from the queue's tables before the
        # queue changes them, so it goes first.
        self.model.unpark(now_ready, self.order_source)
        self.cache.emit('now-tree-branch-ready', None, now_ready)

    @rule(loc=st.sampled_from(kAsync))
    def location_data_lost(self, loc):
        self.cache.MakeUnready([loc])

    # Rules aimed at what is queued or parked, to reach the interesting paths often.

    def known_scans(self):
        known = [(*key, p) for key, p in self.model.ready.items()]
        for items, _ in self.model.parked.values():
            known.extend(items)
        return sorted(known, key=repr)

    @precondition(lambda self: self.model.ready or self.model.parked)
    @rule(data=st.data(), with_priority=st.booleans())
    def remove_known_scan(self, data, with_priority):
        loc, scope, name, priority = data.draw(st.sampled_from(self.known_scans()))
        self.remove_scan_triple(loc, scope, name, priority if with_priority else None)

    @precondition(lambda self: any(key[0].kAsync for key in self.model.ready))
    @rule(data=st.data())
    def lose_data_of_queued_file(self, data):
        queued = sorted({key[0] for key in self.model.ready if key[0].kAsync}, key=repr)
        self.location_data_lost(data.draw(st.sampled_from(queued)))

    @precondition(lambda self: self.model.parked)
    @rule(data=st.data())
    def parked_files_become_ready(self, data):
        parked = sorted(self.model.parked, key=repr)
        chosen = data.draw(st.sets(st.sampled_from(parked), min_size=1))
        self.tree_branches_ready(chosen | data.draw(st.sets(st.sampled_from(kAsync))))

    @precondition(lambda self: self.model.ready)
    @rule(data=st.data(), visible=st.lists(locs, max_size=2))
    def focus_queued_file(self, data, visible):
        queued = sorted({key[0] for key in self.model.ready}, key=repr)
        self.update_visible(data.draw(st.sampled_from(queued)), visible)

    @rule(dice=st.integers(min_value=0, max_value=5))
    def clear(self, dice):
        if dice:  # rarely: it empties everything
            return
        self.model.clear()
        self.each(lambda q, impl: q.Clear())

    @rule()
    def run_main_loop(self):
        for recorder in self.recorders:
            recorder.Clear()
        assert ostrelgtk.run_until_idle(max_iterations=100)
        emitted = [[(signal, args[0] is q, args[1]) for signal, args in r.fEmitted]
                   for q, r in zip(self.queues, self.recorders)]
        for other in emitted[1:]:
            assert other == emitted[0]
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

    # -- checks after every step -------------------------------------------

    @invariant()
    def consistent(self):
        for q in self.queues:
            check_invariants(q)
            self.model.check(q)
        first = snapshot(self.queues[0])
        for q in self.queues[1:]:
            assert snapshot(q) == first
        present = set(self.queues[0]._fPerLocationInfo)
        self.touched |= present ^ self.present
        self.present = present


def test_queue_follows_the_model_and_the_reference():
    run_state_machine_as_test(QueueMachine, settings=_machine_settings(500, 50))


# ----------------------------------------------------------------------
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
