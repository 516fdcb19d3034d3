"""The main job: scan a directory of Python files through the scan coordinator,
driven by the stand-in host application's main loop.

    ./run scan [DIR] [--db FILE] [--no-follow-stdlib] [--idle-priority N] [--quiet]

The host application is assembled for DIR (singletons, analysis manager,
information cache, location data cache), the coordinator is created, every
file under DIR is reported as parseable (AddParseablesToQueue), and the main
loop runs until the coordinator's idle callback ends with empty queues: whole
files are checked against their modification times, primary and derived scans
run in time slices, imported modules are followed, a status report arrives
every second, and the information cache writes its database at the end.
Running it again over the same DIR reuses its database (kept under
build/scan-db) and skips files that have not changed.
"""

import argparse
import os
import sys
import time
from pathlib import Path

import hostapp
from guiutils import ostrelgtk

import pysource.scancoordinator as sc


def main(argv):
    parser = argparse.ArgumentParser(prog="./run scan")
    default_dir = Path(__file__).resolve().parent.parent / "standin"
    parser.add_argument("dir", nargs="?", default=str(default_dir))
    parser.add_argument("--db", help="database file (default: build/scan-db/<DIR>.sqlite)")
    parser.add_argument("--no-follow-stdlib", action="store_true",
                        help="put only DIR on the Python path")
    parser.add_argument("--idle-priority", type=int, default=ostrelgtk.PRIORITY_DEFAULT_IDLE)
    parser.add_argument("--quiet", action="store_true")
    args = parser.parse_args(argv)

    root = Path(args.dir).resolve()
    if not root.is_dir():
        print(f"scan: not a directory: {root}", file=sys.stderr)
        return 2
    if args.db:
        db = args.db
    else:
        db_dir = Path(__file__).resolve().parent.parent / "build" / "scan-db"
        db_dir.mkdir(parents=True, exist_ok=True)
        db = str(db_dir / (str(root).strip("/").replace("/", "_") + ".sqlite"))
    python_path = [str(root)] if args.no_follow_stdlib else None
    app = hostapp.CreateApplication(str(root), db_path=db, python_path=python_path)
    coord = hostapp.CreateScanCoordinator(app, args.idle_priority)
    files = app.ProjectFiles()
    print(f"{sc.__name__}: scanning {len(files)} files under {root}")

    reports = []

    def on_status(_coord, status):
        reports.append(status)
        if not args.quiet:
            queued = ", ".join(f"{q.scan_name} p{q.priority}: {q.file_count}"
                               for q in status.queue_status_list) or "nothing queued"
            print(f"  status: {queued}; waiting {status.waiting_count}")

    ends = []
    coord.connect("scan-status-update", on_status)
    coord.connect("end", lambda *a: ends.append(time.perf_counter()))

    start = time.perf_counter()
    coord.AddParseablesToQueue(files)
    finished = ostrelgtk.run_until_idle(max_iterations=10_000_000)
    elapsed = time.perf_counter() - start

    completed = coord._fScanTripleCompletedCount
    primary = app.fAnaMgr.fPrimaryScanName
    derived = app.fAnaMgr.fDerivedScanName
    n_primary = sum(n for (_, _, name), n in completed.items() if name == primary)
    n_derived = sum(n for (_, _, name), n in completed.items() if name == derived)
    scanned_files = {loc for (loc, _, _) in completed}
    print(f"finished: {finished}; queues empty: {coord.QueuesEmpty()}; "
          f"{elapsed:.2f} s; {len(reports)} status reports; 'end' emitted {len(ends)} times")
    print(f"completed scans: {n_primary} primary, {n_derived} derived, "
          f"over {len(scanned_files)} files (imports followed)")
    in_project = sorted(str(loc.fUrl) for loc in scanned_files
                        if str(loc.fUrl).startswith(root.as_uri()))
    for url in in_project[:10]:
        print(f"  {url}")
    if len(in_project) > 10:
        print(f"  ... and {len(in_project) - 10} more in the project")
    if os.path.exists(db):
        print(f"database: {db} ({os.path.getsize(db)} bytes)")
    app.Shutdown()
    return 0 if finished else 1


if __name__ == "__main__":
    sys.exit(main(sys.argv[1:]))
