"""The main job: load the scan coordinator module in the stand-in host and run
the queueing side of a scan over a directory of Python files.

    ./run scan [DIR]

Prints what the module publishes, then queues every Python file under DIR as a
whole-file primary scan at background priority (the road a parseable file takes
into the queue), shows the queue, and hands the scans out in order until the
queue is empty, as the idle loop will.  Scanning itself (parsing and storing
scope information) runs through the coordinator, which later work adds.
"""

import os
import sys
import time
from pathlib import Path

import pysource.scancoordinator as sc
from guiutils import ostrelgtk
from ostrelbase import destroyable, location

PRIMARY, DERIVED = "primary", "derived"


class LocalDataCache(destroyable.CDestroyable):
    """Location data cache for a local project: every location is ready."""

    def __init__(self):
        super().__init__(("now-tree-branch-ready", "inspect-failed", "cleared"))

    def TreeBranchReady(self, loc, flag):
        return True


def published():
    names = sorted(n for n in vars(sc) if not n.startswith("__"))
    print(f"module {sc.__name__} ({Path(sc.__file__).name})")
    for name in names:
        value = getattr(sc, name)
        if isinstance(value, type):
            kind = "class" if not hasattr(value, "_fields") else f"record {value._fields}"
            print(f"  {name:24} {kind}")
        elif isinstance(value, int):
            print(f"  {name:24} = {value}")
        elif callable(value):
            print(f"  {name:24} function")


def main(argv):
    root = Path(argv[0] if argv else Path(__file__).resolve().parent.parent / "standin")
    if not root.is_dir():
        print(f"scan: not a directory: {root}", file=sys.stderr)
        return 2
    published()
    files = sorted(p for p in root.rglob("*.py") if p.is_file())
    print(f"\n{len(files)} Python files under {root}")
    locs = [location.CreateFromName(os.fspath(p)) for p in files]

    queue = sc._CScanQueue(LocalDataCache())
    queue.SetScansToOrder({PRIMARY: 0, DERIVED: 1})
    added = []
    queue.connect("locations-added", lambda q, locs: added.append(len(locs)))
    t0 = time.perf_counter()
    queue.AddScanPairs([(loc, "*") for loc in locs], PRIMARY, sc.kBackgroundPriority, True)
    t_add = time.perf_counter() - t0
    ostrelgtk.run_until_idle(max_iterations=100)
    print(f"queued {len(locs)} whole-file scans in {t_add * 1e3:.2f} ms; "
          f"'locations-added' reported {sum(added)} locations")
    queue.PrintScanQueues(limit=10)

    checked = 0
    while True:
        batch = queue.PopWholeFilesToCheck()
        if batch is None:
            break
        checked += len(batch)
    order = []
    while True:
        item = queue.First()
        if item.loc is None:
            break
        order.append(item)
        queue.ScanCompleted(item)
    print(f"\n{checked} files handed out for the modification-time check")
    print(f"{len(order)} scans handed out in order; first few:")
    for item in order[:5]:
        print(f"  {item.scan_name} p{item.priority} {item.scope_name} {item.loc.fUrl}")
    print(f"queue empty: {queue.Empty()}")
    queue.destroy()
    return 0 if len(order) == len(locs) else 1


if __name__ == "__main__":
    sys.exit(main(sys.argv[1:]))
