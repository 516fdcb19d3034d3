"""Fixtures and helpers shared by the scan-queue tests.

Test modules import everything from here (`from scanqueue_fixtures import *`).
Every test that takes `impl` runs twice: against the pure-Python model in
tests/reference and against the compiled module.  A compiled module that does
not import is an error, never a skip.
"""
import collections
import importlib
import types

import pytest
import singleton
from doubles import AsyncInspectProbe, FakeLocationDataCache, SignalRecorder
from guiutils import ostrelgtk
from ostrelbase import location

# Two scan names with distinct orders, as the analysis manager uses them.
S = 'primary'
T = 'derived'
kOrders = {S: 0, T: 1}
kWildcard = '*'

__all__ = [
    'Impl',
    'S',
    'T',
    'async_probe',
    'check_invariants',
    'clean_host',
    'compiled',
    'data_cache',
    'impl',
    'kOrders',
    'kWildcard',
    'load_impl',
    'make_queue',
    'queue',
    'queued_scans',
    'run_idles',
    'signals',
    'snapshot',
]


class Impl(types.SimpleNamespace):
    """One implementation of the scan queue: its classes, records and constants."""

    def __repr__(self):
        return f'<Impl {self.name}>'


def load_impl(name):
    if name == 'reference':
        module = importlib.import_module('reference.scanqueue')
    else:
        module = importlib.import_module('pysource.scancoordinator')
    return Impl(
        name=name,
        module=module,
        SingleQueue=module._CSingleScanQueue,
        Queue=module._CScanQueue,
        CScanItem=module.CScanItem,
        kTypingModulePriority=module.kTypingModulePriority,
        kInteractivePriority=module.kInteractivePriority,
        kBackgroundPriority=module.kBackgroundPriority,
    )


def run_idles(max_iterations=100):
    """Runs the stand-in main loop until no idle callback is pending."""
    assert ostrelgtk.run_until_idle(max_iterations=max_iterations)


@pytest.fixture(autouse=True)
def clean_host():
    """A fresh main loop and fresh singletons for every test."""
    ostrelgtk.reset()
    singleton.ResetSingletons()
    yield
    ostrelgtk.reset()
    singleton.ResetSingletons()


@pytest.fixture(autouse=True)
def async_probe(monkeypatch):
    """`location.IsAsyncInspectLocation` answers from the location doubles' kind."""
    probe = AsyncInspectProbe()
    monkeypatch.setattr(location, 'IsAsyncInspectLocation', probe)
    return probe


@pytest.fixture(params=['reference', 'compiled'])
def impl(request):
    return load_impl(request.param)


@pytest.fixture
def compiled():
    return load_impl('compiled')


@pytest.fixture
def data_cache():
    cache = FakeLocationDataCache()
    yield cache
    cache.destroy()


def make_queue(impl, data_cache, orders=kOrders, cls=None):
    q = (cls or impl.Queue)(data_cache)
    if orders is not None:
        q.SetScansToOrder(dict(orders))
    return q


@pytest.fixture
def queue(impl, data_cache):
    q = make_queue(impl, data_cache)
    yield q
    q.destroy()


@pytest.fixture
def signals(queue):
    return SignalRecorder(queue, ('locations-added', 'locations-removed'))


def queued_scans(q):
    """The ready scans as the single queues hold them: {(loc, scope, name): priority}.

    Scans are attributed to the single queue's scan name, which is right as long
    as distinct scan names have distinct orders."""
    result = {}
    for sq in q._fOrderedQueues:
        for loc, names in sq.fOrderedDict.items():
            for name in names:
                key = (loc, name, sq.fScanName)
                assert key not in result, f'{key} queued at {result[key]} and {sq.fPriority}'
                result[key] = sq.fPriority
    return result


def check_invariants(q):
    """Asserts the structural invariants of a scan queue by reading its fields."""
    orders = q._fScansToOrder or {}
    keys = [(sq.fPriority, sq.fOrder) for sq in q._fOrderedQueues]
    assert keys == sorted(keys) and len(set(keys)) == len(keys), keys

    # Every name in a single queue's lists, attributed to (loc, priority, order).
    listed = set()
    for sq in q._fOrderedQueues:
        for loc, names in sq.fOrderedDict.items():
            assert type(names) is list and names, (loc, names)
            assert names == sorted(set(names)), (loc, names)
            assert kWildcard not in names or names == [kWildcard], (loc, names)
            for name in names:
                listed.add((loc, sq.fPriority, sq.fOrder, name))

    # Every ready scan is recorded in the pending dict and counted, once.
    recorded = set()
    per_name_totals = {}
    for loc, info in q._fPerLocationInfo.items():
        assert loc not in q._fWaitingForInspectByLoc, f'{loc!r} both queued and parked'
        assert type(info) is tuple and len(info) == 2, info
        counts, pending = info
        assert type(counts) is collections.defaultdict and type(pending) is dict, info
        assert pending, f'{loc!r} has an entry without pending scans'
        expected_counts = {}
        for (scope, name), priority in pending.items():
            recorded.add((loc, priority, orders.get(name, 0), scope))
            expected_counts[name] = expected_counts.get(name, 0) + 1
        assert dict(counts) == expected_counts, (loc, dict(counts), expected_counts)
        for name, n in expected_counts.items():
            scans, locs = per_name_totals.get(name, (0, 0))
            per_name_totals[name] = (scans + n, locs + 1)
    assert listed == recorded, (
        f'only in single queues: {listed - recorded}; only in pending dicts: {recorded - listed}')
    assert dict(q._fPerScanNameCounts) == per_name_totals

    for loc, entry in q._fWaitingForInspectByLoc.items():
        assert type(entry) is tuple and len(entry) == 2, entry
        items, check_priority = entry
        assert type(items) is set and items, (loc, entry)
        assert check_priority is None or isinstance(check_priority, int)
        for item in items:
            assert item.loc == loc and None not in (item.scope_name, item.scan_name), item


def _plain_queue(sq):
    return (sq.fScanName, sq.fPriority, sq.fOrder,
            [(loc, list(names)) for loc, names in sq.fOrderedDict.items()])


def snapshot(q):
    """Every field of a scan queue as plain Python values, for comparisons.

    Ordered things (single queues, their locations and names, the whole files to
    check) become lists; unordered ones become sets and dicts."""
    return {
        'fAnyAsyncInspectLocation': q.fAnyAsyncInspectLocation,
        '_fScansToOrder': (None if q._fScansToOrder is None else dict(q._fScansToOrder)),
        '_fOrderedQueues': [_plain_queue(sq) for sq in q._fOrderedQueues],
        '_fPerLocationInfo': {loc: (dict(counts), dict(pending))
                              for loc, (counts, pending) in q._fPerLocationInfo.items()},
        '_fPerScanNameCounts': dict(q._fPerScanNameCounts),
        '_fCompletedCount': {tuple(k): v for k, v in q._fCompletedCount.items()},
        '_fPendingLocationsAdded': set(q._fPendingLocationsAdded),
        '_fPendingLocationsRemoved': set(q._fPendingLocationsRemoved),
        'emission scheduled': q._fSignalEmitIdle is not None,
        '_fWaitingForInspectByLoc': {loc: ({tuple(i) for i in items}, prio)
                                     for loc, (items, prio) in
                                     q._fWaitingForInspectByLoc.items()},
        '_fScanItemsWaitingForData': {tuple(i) for i in q._fScanItemsWaitingForData},
        '_fActiveDocLoc': q._fActiveDocLoc,
        '_fVisibleDocLocs': set(q._fVisibleDocLocs),
        '_fWholeFilesToCheck': list(q._fWholeFilesToCheck.items()),
    }
