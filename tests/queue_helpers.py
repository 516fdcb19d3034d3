"""Fixtures and checks shared by the scan-queue tests; a test that takes `impl`
runs against the compiled queue and against bench/reference_queue.py."""
import collections
import types

import pytest
import reference_queue
from doubles import AsyncInspectProbe, FakeLocationDataCache, SignalRecorder
from guiutils import ostrelgtk
from ostrelbase import location

import pysource.scancoordinator as sc

__all__ = ['S', 'T', 'check_invariants', 'kOrders', 'load_impl', 'make_queue', 'parked',
           'queued_scans', 'run_idles', 'snapshot']

S = 'primary'
T = 'derived'
kOrders = {S: 0, T: 1}


def load_impl(name):
    module = reference_queue if name == 'reference' else sc
    return types.SimpleNamespace(name=name, Queue=module._CScanQueue,
                                 SingleQueue=module._CSingleScanQueue, CScanItem=module.CScanItem)


def run_idles():
    assert ostrelgtk.run_until_idle(max_iterations=100)


@pytest.fixture
def async_probe(monkeypatch):
    """`location.IsAsyncInspectLocation` answers from the location doubles' kind."""
    probe = AsyncInspectProbe()
    monkeypatch.setattr(location, 'IsAsyncInspectLocation', probe)
    return probe


@pytest.fixture(params=['compiled', 'reference'])
def impl(request):
    return load_impl(request.param)


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
def queue(data_cache):
    q = make_queue(load_impl('compiled'), data_cache)
    yield q
    q.destroy()


@pytest.fixture
def signals(queue):
    return SignalRecorder(queue, ('locations-added', 'locations-removed'))


def queued_scans(q):
    """The ready scans as the single queues hold them: {(loc, scope, name): priority}."""
    return {(loc, name, sq.fScanName): sq.fPriority
            for sq in q._fOrderedQueues for loc, names in sq.fOrderedDict.items()
            for name in names}


def parked(q):
    return {loc: ({tuple(i) for i in items}, check)
            for loc, (items, check) in q._fWaitingForInspectByLoc.items()}


def check_invariants(q):
    """Asserts the structural invariants of a scan queue by reading its fields."""
    orders = q._fScansToOrder or {}
    keys = [(sq.fPriority, sq.fOrder) for sq in q._fOrderedQueues]
    assert keys == sorted(keys) and len(set(keys)) == len(keys), keys
    listed = set()
    for sq in q._fOrderedQueues:
        for loc, names in sq.fOrderedDict.items():
            assert type(names) is list and names, (loc, names)
            assert names == sorted(set(names)), (loc, names)
            assert '*' not in names or names == ['*'], (loc, names)
            listed.update((loc, sq.fPriority, sq.fOrder, name) for name in names)
    recorded = set()
    totals = {}
    for loc, (counts, pending) in q._fPerLocationInfo.items():
        assert loc not in q._fWaitingForInspectByLoc, f'{loc!r} both queued and parked'
        assert type(counts) is collections.defaultdict and pending, (loc, counts, pending)
        per_name = collections.Counter(name for (_scope, name) in pending)
        recorded.update((loc, p, orders.get(name, 0), scope)
                        for (scope, name), p in pending.items())
        assert dict(counts) == per_name
        for name, n in per_name.items():
            scans, locs = totals.get(name, (0, 0))
            totals[name] = (scans + n, locs + 1)
    assert listed == recorded, (listed - recorded, recorded - listed)
    assert dict(q._fPerScanNameCounts) == totals
    for loc, (items, check) in q._fWaitingForInspectByLoc.items():
        assert type(items) is set and items and (check is None or isinstance(check, int))
        assert all(i.loc == loc for i in items)


def snapshot(q):
    """Every field of a scan queue as plain Python values, for comparisons."""
    return {
        'fAnyAsyncInspectLocation': q.fAnyAsyncInspectLocation,
        '_fScansToOrder': None if q._fScansToOrder is None else dict(q._fScansToOrder),
        '_fOrderedQueues': [(sq.fScanName, sq.fPriority, sq.fOrder,
                             [(loc, list(names)) for loc, names in sq.fOrderedDict.items()])
                            for sq in q._fOrderedQueues],
        '_fPerLocationInfo': {loc: (dict(counts), dict(pending))
                              for loc, (counts, pending) in q._fPerLocationInfo.items()},
        '_fPerScanNameCounts': dict(q._fPerScanNameCounts),
        '_fCompletedCount': {tuple(k): v for k, v in q._fCompletedCount.items()},
        '_fPendingLocationsAdded': set(q._fPendingLocationsAdded),
        '_fPendingLocationsRemoved': set(q._fPendingLocationsRemoved),
        'emission scheduled': q._fSignalEmitIdle is not None,
        '_fWaitingForInspectByLoc': parked(q),
        '_fScanItemsWaitingForData': {tuple(i) for i in q._fScanItemsWaitingForData},
        '_fActiveDocLoc': q._fActiveDocLoc,
        '_fVisibleDocLocs': set(q._fVisibleDocLocs),
        '_fWholeFilesToCheck': list(q._fWholeFilesToCheck.items()),
    }
