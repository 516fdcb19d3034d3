#!/usr/bin/env python3
"""Scan-queue benchmark: the compiled _CScanQueue against the pure-Python one.

    ./run bench queue [--repeat N] [--locations N] [--impl compiled|reference] [--gc]
                      [--clock wall|cpu]

Workloads, on LOCATIONS files x 3 scope names under one scan name:
  add        AddScanPairs of every pair in one call, priority 2, add_to_check
  promote    the same pairs again at priority 1 (every scan moves)
  drain      First() then ScanCompleted(item) until the queue is empty
  remove     RemoveAllForLocations of every file (after re-adding at priority 2)
  memory     resident-set growth per queued scan after `add`, measured in a fresh
             process each time so that memory freed by earlier runs cannot hide it

Each workload runs on a fresh queue per repetition; the table shows medians.  The
garbage collector is off while a workload is timed (as timeit does) unless --gc; with
--gc the collections each workload triggered are shown per generation (gen2 is a full
collection: a walk over the whole heap).  --clock cpu times with the thread's CPU time
instead of wall time (for a machine shared with other load).
"""
import argparse
import gc
import os
import statistics
import subprocess
import sys
import time
from pathlib import Path

ROOT = Path(__file__).resolve().parent.parent
sys.path.insert(0, str(ROOT / 'tests'))

from doubles import FakeLocationDataCache
from guiutils import ostrelgtk
from ostrelbase import location

kScanName = 'primary'
kScopes = ('main', 'CBuffer', 'CBuffer.Flush')
kTargets = {'add': 450, 'promote': 700, 'drain': 700, 'remove': 350, 'memory': 300}
kUnits = {'memory': 'B/scan'}

# Locations are plain path strings, so hashing and comparing them runs at C speed as
# the host's own location objects do.  None of them is remote; the async predicate is
# membership in the empty set of remote locations: a C-level call that answers False,
# costing about what the host's own check costs per pair.
location.IsAsyncInspectLocation = frozenset().__contains__


def load(impl):
    if impl == 'compiled':
        from pysource import scancoordinator
        return scancoordinator
    import reference_queue as scanqueue
    return scanqueue


def make_locations(n):
    return [f'/home/dev/project/pkg{i // 200}/module{i}.py' for i in range(n)]


def make_pairs(locs):
    return [(loc, scope) for loc in locs for scope in kScopes]


class Bench:
    def __init__(self, module, n_locations, keep_gc, clock=time.perf_counter_ns):
        self.module = module
        self.locs = make_locations(n_locations)
        self.pairs = make_pairs(self.locs)
        self.keep_gc = keep_gc
        self.clock = clock
        self.cache = FakeLocationDataCache()
        self.collections = {}

    def new_queue(self):
        q = self.module._CScanQueue(self.cache)
        q.SetScansToOrder({kScanName: 0})
        return q

    def timed(self, name, fn):
        gc.collect()
        if not self.keep_gc:
            gc.disable()
        try:
            before = [g['collections'] for g in gc.get_stats()]
            t0 = self.clock()
            fn()
            elapsed = self.clock() - t0
            after = [g['collections'] for g in gc.get_stats()]
        finally:
            gc.enable()
        self.collections.setdefault(name, []).append(tuple(a - b for a, b in zip(after, before)))
        ostrelgtk.run_until_idle()
        return elapsed / len(self.pairs)

    def run_once(self):
        """One repetition of the timed workloads; returns {workload: ns per scan}."""
        pairs = self.pairs
        q = self.new_queue()
        result = {}
        result['add'] = self.timed('add', lambda: q.AddScanPairs(pairs, kScanName, 2, True))
        assert q.GetFileCount(kScanName, 2) == len(self.locs)
        result['promote'] = self.timed('promote', lambda: q.AddScanPairs(pairs, kScanName, 1, True))
        assert q.GetFileCount(kScanName, 1) == len(self.locs)
        assert q.GetFileCount(kScanName, 2) == 0

        def drain():
            First, ScanCompleted = q.First, q.ScanCompleted
            while True:
                item = First()
                if item.loc is None:
                    break
                ScanCompleted(item)

        result['drain'] = self.timed('drain', drain)
        assert q.Empty()
        q.AddScanPairs(pairs, kScanName, 2, True)
        ostrelgtk.run_until_idle()
        result['remove'] = self.timed('remove', lambda: q.RemoveAllForLocations(self.locs))
        assert q.Empty()
        q.destroy()
        ostrelgtk.run_until_idle()
        return result


def rss_bytes():
    with open('/proc/self/statm') as f:
        return int(f.read().split()[1]) * os.sysconf('SC_PAGE_SIZE')


def memory_child(impl, n_locations):
    """Runs in a fresh interpreter: prints the RSS growth per scan queued by `add`."""
    module = load(impl)
    bench = Bench(module, n_locations, keep_gc=True)
    q = bench.new_queue()
    q.AddScanPairs(bench.pairs[:3], kScanName, 2, True)  # first-use allocations
    q.RemoveAllForLocations(bench.locs[:1])
    ostrelgtk.run_until_idle()
    gc.collect()
    before = rss_bytes()
    q.AddScanPairs(bench.pairs, kScanName, 2, True)
    ostrelgtk.run_until_idle()  # the announcement of the new files is transient
    gc.collect()
    after = rss_bytes()
    assert q.GetFileCount(kScanName, 2) == len(bench.locs)
    print((after - before) / len(bench.pairs))


def measure_memory(impl, n_locations):
    out = subprocess.run(
        [sys.executable, __file__, '--memory-child', impl, '--locations', str(n_locations)],
        check=True, capture_output=True, text=True)
    return float(out.stdout.strip().splitlines()[-1])


def main(argv):
    parser = argparse.ArgumentParser(description=__doc__.splitlines()[0])
    parser.add_argument('--repeat', type=int, default=5, help='repetitions (default 5)')
    parser.add_argument('--locations', type=int, default=20000,
                        help='number of files (default 20000; 3 scopes each)')
    parser.add_argument('--impl', choices=['compiled', 'reference'], action='append',
                        help='run one implementation only (default: both)')
    parser.add_argument('--gc', action='store_true', help='keep the cyclic GC on while timing')
    parser.add_argument('--clock', choices=['wall', 'cpu'], default='wall',
                        help='time with wall time (default) or the thread\'s CPU time')
    parser.add_argument('--memory-child', choices=['compiled', 'reference'],
                        help=argparse.SUPPRESS)
    args = parser.parse_args(argv)
    if args.memory_child:
        memory_child(args.memory_child, args.locations)
        return 0
    if args.repeat < 1:
        parser.error('--repeat must be at least 1')
    impls = args.impl or ['compiled', 'reference']

    medians = {}
    collections = {}
    for impl in impls:
        clock = time.thread_time_ns if args.clock == 'cpu' else time.perf_counter_ns
        bench = Bench(load(impl), args.locations, args.gc, clock)
        collections[impl] = bench.collections
        runs = [bench.run_once() for _ in range(args.repeat)]
        medians[impl] = {w: statistics.median(r[w] for r in runs) for w in runs[0]}
        medians[impl]['memory'] = statistics.median(
            measure_memory(impl, args.locations) for _ in range(args.repeat))

    n_scans = args.locations * len(kScopes)
    print(f'scan queue: {args.locations} files x {len(kScopes)} scopes = {n_scans} scans, '
          f'one scan name; median of {args.repeat} runs; '
          f'GC {"on" if args.gc else "off"} while timed; {args.clock} time')
    header = ('workload', 'compiled ns/scan', 'reference ns/scan', 'ratio', 'target')
    rows = []
    missed = []
    for workload, target in kTargets.items():
        unit = kUnits.get(workload, '')
        cells = []
        for impl in ('compiled', 'reference'):
            value = medians.get(impl, {}).get(workload)
            cells.append('-' if value is None else f'{value:,.0f}{" " + unit if unit else ""}')
        c = medians.get('compiled', {}).get(workload)
        r = medians.get('reference', {}).get(workload)
        ratio = f'{r / c:.1f}x' if c and r else '-'
        if c is not None and c > target:
            missed.append(workload)
        rows.append((workload, *cells, ratio, f'<= {target}{" " + unit if unit else ""}'))
    widths = [max(len(str(row[i])) for row in [header, *rows]) for i in range(len(header))]
    for row in [header, tuple('-' * w for w in widths), *rows]:
        print('  '.join(str(cell).rjust(w) if i else str(cell).ljust(w)
                        for i, (cell, w) in enumerate(zip(row, widths))))
    print('ratio: reference / compiled.  memory column: bytes of resident set per queued scan.')
    if args.gc:
        print('collections while timed (gen0/gen1/gen2, median over runs):')
        for impl in impls:
            print(f'  {impl}: ' + ', '.join(
                f'{w} ' + '/'.join(f'{statistics.median(c[i] for c in counts):g}'
                                   for i in range(3))
                for w, counts in collections[impl].items()))
    if 'compiled' in medians:
        print('compiled misses target: ' + (', '.join(missed) if missed else 'none'))
    return 0


if __name__ == '__main__':
    sys.exit(main(sys.argv[1:]))
