"""A location's __hash__ may run arbitrary Python code, including calls back into the
same queue.  The queue's answers may then be surprising, but it must never crash,
and it must stay usable and destroyable afterwards."""

import random

import pytest
from guiutils import ostrelgtk
from ostrelbase import destroyable, location

import pysource.scancoordinator as sc

# What a re-entered queue may reasonably report.
TOLERATED = (AssertionError, RuntimeError, KeyError, IndexError, ValueError, TypeError)


class _Cache(destroyable.CDestroyable):
    def __init__(self, rng):
        super().__init__(('now-tree-branch-ready', 'inspect-failed', 'cleared'))
        self.rng = rng

    def TreeBranchReady(self, loc, flag):
        return self.rng.random() < 0.5


class _ReentrantLoc:
    """Hashes to few buckets and, now and then, operates on the queue from __hash__."""
    queue = None

    def __init__(self, n, rng, locs):
        self.n, self.rng, self.locs = n, rng, locs
        self.fUrl = f'file:///src/e{n}.py'

    def __hash__(self):
        q = _ReentrantLoc.queue
        if q is not None and self.rng.random() < 0.05:
            _ReentrantLoc.queue = None  # one level of re-entry at a time
            try:
                self.rng.choice([
                    lambda: q.RemoveAllForLocations([self.rng.choice(self.locs)]),
                    lambda: q.AddScanPairs([(self.rng.choice(self.locs), 'a')], 'p'),
                    q.First, q.Clear,
                    lambda: q.UpdateForVisibleDocuments(self.locs[0], self.locs[1:3])])()
            except TOLERATED:
                pass
            finally:
                _ReentrantLoc.queue = q
        return hash(self.n % 5)

    def __eq__(self, other):
        return isinstance(other, _ReentrantLoc) and other.n == self.n

    def __repr__(self):
        return f'E{self.n}'


def random_operation(q, rng, locs):
    rng.choice([
        lambda: q.AddScanPairs([(rng.choice(locs), rng.choice('abc*')) for _ in range(3)],
                               rng.choice('pd'), rng.randrange(4), rng.random() < 0.5),
        lambda: q.RemoveScanTriple((rng.choice(locs), rng.choice('abc*'), 'p')),
        lambda: q.First().loc is not None and q.ScanCompleted(q.First()),
        lambda: q.RemoveAllForLocations(rng.sample(locs, 3)),
        lambda: q._fLocationDataCache.emit('now-tree-branch-ready', None,
                                           set(rng.sample(locs, 4))),
        lambda: ostrelgtk.run_until_idle(100)])()


@pytest.mark.parametrize('seed', range(4))
def test_reentrant_hashing_never_breaks_the_queue(monkeypatch, seed):
    rng = random.Random(seed)
    locs = []
    locs.extend(_ReentrantLoc(i, rng, locs) for i in range(10))
    monkeypatch.setattr(location, 'IsAsyncInspectLocation', lambda loc: loc.n % 3 == 0)
    for _ in range(15):
        q = sc._CScanQueue(_Cache(rng))
        q.SetScansToOrder({'p': 0, 'd': 1})
        _ReentrantLoc.queue = q
        try:
            for _ in range(40):
                try:
                    random_operation(q, rng, locs)
                except TOLERATED:
                    pass
        finally:
            _ReentrantLoc.queue = None
        # Still usable: a fresh add and a full drain work, then it is destroyed.
        q.Clear()
        q.AddScanPairs([(locs[1], 'a')], 'p', 2)
        assert q.First()[:3] == (locs[1], 'a', 'p')
        q.destroy()
        assert q.Empty()
    ostrelgtk.reset()
