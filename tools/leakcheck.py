"""Leak check: objects are freed inside reference cycles, and memory stays flat
over a long run of queue operations.

    ./run leakcheck [--rounds N]

1. A scan queue whose location data cache refers back to it (a cycle through
   Python objects and signal connections), destroyed and dropped, must be freed
   by gc.collect(): its weak reference dies.
2. Many rounds of create / add / promote / drain / remove / destroy must not grow
   the resident set: growth between an early and the last round is printed and
   must stay under a small bound.
Exits non-zero when either check fails.
"""

import argparse
import gc
import sys
import weakref

from guiutils import ostrelgtk
from ostrelbase import destroyable

import pysource.scancoordinator as sc


class DataCache(destroyable.CDestroyable):
    def __init__(self):
        super().__init__(("now-tree-branch-ready", "inspect-failed", "cleared"))
        self.queue = None

    def TreeBranchReady(self, loc, flag):
        return True


def rss_bytes():
    with open("/proc/self/statm") as f:
        return int(f.read().split()[1]) * 4096


def cycle_check():
    cache = DataCache()
    queue = sc._CScanQueue(cache)
    cache.queue = queue  # the cache refers back to the queue
    queue.SetScansToOrder({"p": 0})
    queue.AddScanPairs([(f"loc{i}", "*") for i in range(100)], "p", 2, True)
    queue.connect("locations-added", lambda *args, q=queue: q.Empty())  # handler -> queue
    ref_q, ref_c = weakref.ref(queue), weakref.ref(cache)
    queue.destroy()
    del queue, cache
    ostrelgtk.reset()
    gc.collect()
    ok = ref_q() is None and ref_c() is None
    print(f"cycle check: queue freed={ref_q() is None} data cache freed={ref_c() is None}")
    return ok


def one_round(n):
    cache = DataCache()
    queue = sc._CScanQueue(cache)
    cache.queue = queue
    queue.SetScansToOrder({"p": 0, "d": 1})
    pairs = [(f"loc{i}", s) for i in range(n) for s in ("a", "b", "c")]
    queue.AddScanPairs(pairs, "p", 2, True)
    queue.AddScanPairs(pairs[: n // 2], "p", 1)
    queue.AddScanPairs([(f"loc{i}", "*") for i in range(n // 4)], "d", 2)
    queue.UpdateForVisibleDocuments("loc1", ["loc2", "loc3"])
    queue.PopWholeFilesToCheck()
    for _ in range(n):
        item = queue.First()
        if item.loc is None:
            break
        queue.ScanCompleted(item)
    queue.RemoveAllForLocations([f"loc{i}" for i in range(n)])
    ostrelgtk.run_until_idle(max_iterations=1000)
    queue.destroy()


def memory_check(rounds):
    for _ in range(10):
        one_round(500)
    gc.collect()
    before = rss_bytes()
    for _ in range(rounds):
        one_round(500)
    gc.collect()
    after = rss_bytes()
    growth = after - before
    print(f"memory check: {rounds} rounds, resident set {before / 2**20:.1f} MiB -> "
          f"{after / 2**20:.1f} MiB (growth {growth / 1024:.0f} KiB)")
    return growth < 2 * 2**20


def coordinator_round(project_dir):
    """Build the host application for a small project, scan it through a
    coordinator, destroy everything; returns weak references to what must die."""
    import hostapp
    app = hostapp.CreateApplication(project_dir, python_path=[project_dir], load_database=False)
    coord = hostapp.CreateScanCoordinator(app)
    coord.AddParseablesToQueue(app.ProjectFiles())
    ostrelgtk.run_until_idle(max_iterations=100000)
    refs = (weakref.ref(coord), weakref.ref(app.fAnaMgr), weakref.ref(coord._fScanQueue))
    coord.destroy()
    app.Shutdown()
    del coord, app
    ostrelgtk.reset()
    return refs


def coordinator_check(rounds):
    import tempfile
    with tempfile.TemporaryDirectory() as d:
        for i in range(5):
            with open(f"{d}/mod{i}.py", "w") as f:
                f.write(f"import os\nclass C{i}:\n    def m(self):\n        return os.sep\n")
        refs = coordinator_round(d)
        gc.collect()
        freed = all(r() is None for r in refs)
        print(f"coordinator cycle check: coordinator, analysis manager and queue freed={freed}")
        # Warm-up: the host's and the interpreter's caches and free lists fill
        # during the first rounds; the check is that memory then stays flat.
        for _ in range(40):
            coordinator_round(d)
        gc.collect()
        before = rss_bytes()
        for _ in range(rounds):
            coordinator_round(d)
        gc.collect()
        growth = rss_bytes() - before
        print(f"coordinator memory check: {rounds} scan rounds, resident set growth "
              f"{growth / 1024:.0f} KiB")
    return freed and growth < 2 * 2**20


def main():
    parser = argparse.ArgumentParser()
    parser.add_argument("--rounds", type=int, default=300)
    args = parser.parse_args()
    ok = cycle_check()
    ok = memory_check(args.rounds) and ok
    ok = coordinator_check(max(20, args.rounds // 10)) and ok
    print("leak check passed" if ok else "leak check FAILED")
    return 0 if ok else 1


if __name__ == "__main__":
    sys.exit(main())
