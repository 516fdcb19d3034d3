"""The main job: scan a directory of Python files through the scan coordinator,
driven by the stand-in host application's main loop.

    ./run scan [DIR] [--db FILE] [--exclude NAME]... [--no-follow-stdlib]
               [--plain | --quiet] [--json FILE] [--helper] [--remote-latency SECONDS]

The host application is assembled for DIR (singletons, analysis manager,
information cache, location data cache), the coordinator is created, every
file under DIR is reported as parseable (AddParseablesToQueue), and the main
loop runs until the coordinator's idle callback ends with empty queues: whole
files are checked against their modification times, primary and derived scans
run in time slices, imported modules are followed, a status report arrives
every second (shown as progress), and the information cache writes its
database at the end.  A summary table follows (``--json`` writes the same
figures for scripts).

Running it again over the same DIR reuses its database (kept under
build/scan-db) and skips files that have not changed.  Ctrl-C or SIGTERM stops
between two main-loop callbacks: the coordinator is told it is quitting, what
was scanned so far is written in one transaction, and the next run goes on
from there.

Exit status: 0 when the scan completed (files that could not be read are
listed, not fatal), 1 when the results could not be written, 2 for an
unusable DIR or database, 128 + the signal number when interrupted.
"""
import time

_kStarted = time.perf_counter()  # before the heavy imports: start-up is timed from here

import argparse
import json
import os
import resource
import signal
import sys
from pathlib import Path

import hostapp
import remoteproject
import scanloop
import scanreport
from guiutils import ostrelgtk
from ostrelbase import location, mime
from rich.console import Console

from pysource import helperproc, infodb

ROOT = Path(__file__).resolve().parent.parent
kExitWriteFailed = 1
kExitUsage = 2


class CUsageError(Exception):
    """Bad input that stops the job before it starts; the message is one line."""


def ProcessAge() -> float:
    """Seconds since this process started (from /proc where there is one, else
    since this module started loading)."""
    try:
        with open('/proc/self/stat', 'rb') as f:
            fields = f.read().rpartition(b')')[2].split()
        start_ticks = int(fields[19])
        with open('/proc/uptime', 'rb') as f:
            uptime = float(f.read().split()[0])
        return max(0.0, uptime - start_ticks / os.sysconf('SC_CLK_TCK'))
    except (OSError, ValueError, IndexError):
        return time.perf_counter() - _kStarted


def DefaultDatabase(root: Path) -> str:
    name = str(root).strip('/').replace('/', '_') or 'root'
    return str(ROOT / 'build' / 'scan-db' / (name + '.sqlite'))


def CheckDirectory(path: str) -> Path:
    root = Path(path).expanduser().absolute()
    if not root.exists():
        raise CUsageError(f'no such directory: {path}')
    if not root.is_dir():
        raise CUsageError(f'not a directory: {path}')
    try:
        with os.scandir(root):
            pass
    except OSError as exc:
        raise CUsageError(f'cannot read directory {path}: {exc.strerror or exc}') from None
    return Path(os.path.realpath(root))


def CheckDatabasePath(db: str) -> None:
    """Refuse what cannot work before any scanning is done."""
    if os.path.isdir(db):
        raise CUsageError(f'database path is a directory: {db}')
    directory = os.path.dirname(os.path.abspath(db))
    if os.path.exists(db):
        # Honour a read-only marking even where the file system would not (root).
        if not os.stat(db).st_mode & 0o222 or not os.access(db, os.W_OK):
            raise CUsageError(f'database is read-only: {db} (give another file with --db)')
        if not os.access(directory, os.W_OK):
            raise CUsageError(f'database directory is not writable: {directory}')
    elif os.path.isdir(directory) and not os.access(directory, os.W_OK):
        raise CUsageError(f'database directory is not writable: {directory}')


class CStopRequest:
    """Set by SIGINT or SIGTERM; the main loop stops before its next callback.

    The handler only records the signal (it may run between any two bytecodes)
    and gives the signal back its default action, so a second one ends the
    process at once; the database stays valid either way (sqlite's journal)."""

    def __init__(self) -> None:
        self.fSignal: int | None = None
        self._fPrevious: dict[int, object] = {}

    def Install(self) -> None:
        for signum in (signal.SIGINT, signal.SIGTERM):
            self._fPrevious[signum] = signal.signal(signum, self._Handle)

    def Uninstall(self) -> None:
        for signum, previous in self._fPrevious.items():
            signal.signal(signum, previous)
        self._fPrevious.clear()

    def _Handle(self, signum: int, _frame: object) -> None:
        if self.fSignal is None:
            self.fSignal = signum
        signal.signal(signum, signal.SIG_DFL)

    def __call__(self) -> bool:
        return self.fSignal is not None


def ParseArgs(argv: list[str]) -> argparse.Namespace:
    parser = argparse.ArgumentParser(
        prog='./run scan', description='Scan DIR through the scan coordinator and store what '
        'was found in a database; a second run skips unchanged files.')
    parser.add_argument('dir', nargs='?', default=str(ROOT / 'standin'),
                        help='directory to scan (default: the stand-in host)')
    parser.add_argument('--db', help='database file (default: build/scan-db/<DIR>.sqlite)')
    parser.add_argument('--exclude', action='append', default=[], metavar='NAME',
                        help='skip files and directories with this name (repeatable)')
    parser.add_argument('--no-follow-stdlib', action='store_true',
                        help='put only DIR on the Python path (imports into the standard '
                        'library are not followed)')
    parser.add_argument('--idle-priority', type=int, default=ostrelgtk.PRIORITY_DEFAULT_IDLE,
                        help=argparse.SUPPRESS)
    shown = parser.add_mutually_exclusive_group()
    shown.add_argument('--plain', action='store_true',
                       help='one progress line per second instead of the live display')
    shown.add_argument('--quiet', action='store_true', help='print only the summary')
    parser.add_argument('--json', metavar='FILE',
                        help="write the summary's figures as JSON to FILE ('-': standard "
                        'output, instead of the table)')
    parser.add_argument('--helper', action='store_true',
                        help='scan whole files in a helper process as well')
    parser.add_argument('--remote-latency', type=float, metavar='SECONDS',
                        help="reach DIR's files through a remote agent answering after "
                        'SECONDS')
    args = parser.parse_args(argv)
    if args.remote_latency is not None and not 0 <= args.remote_latency <= 60:
        parser.error('--remote-latency: give a number of seconds from 0 to 60')
    return args


def main(argv: list[str]) -> int:
    args = ParseArgs(argv)
    try:
        root = CheckDirectory(args.dir)
        db = os.path.abspath(args.db) if args.db else DefaultDatabase(root)
        CheckDatabasePath(db)
        python_path = [str(root)] if args.no_follow_stdlib else None
        remote = None
        if args.remote_latency is not None:
            remote = remoteproject.CRemoteProject(str(root), args.remote_latency)
            python_path = remote.PythonPath(not args.no_follow_stdlib)
        app = hostapp.CreateApplication(str(root), db_path=db, python_path=python_path,
                                        load_database=False)
        app.fRemote = remote
        try:
            app.fAnaMgr.fInfoCache.LoadFromDatabase()
        except infodb.CDatabaseError as exc:
            app.Shutdown()
            raise CUsageError(str(exc)) from None
    except CUsageError as exc:
        Error(str(exc))
        return kExitUsage
    return Run(app, root, db, args)


def Error(message: str) -> None:
    """One line on standard error (never wrapped: scripts match on it)."""
    print(f'scan: {scanreport.DisplayPath(message)}', file=sys.stderr, flush=True)


def Run(app: hostapp.CApplication, root: Path, db: str, args: argparse.Namespace) -> int:
    json_to_stdout = args.json == '-'
    console = Console(highlight=False, stderr=json_to_stdout)
    if not console.is_terminal and 'COLUMNS' not in os.environ:
        console.width = 110  # a log file or pipe: not the 80 columns of a terminal
    if app.fAnaMgr.fInfoCache.DatabaseWasRebuilt():
        Error(f'{db} was written by another version; it is rebuilt')
    timing = hostapp.CHostTiming()
    timing.Install()
    stop = CStopRequest()
    stop.Install()
    try:
        coord = hostapp.CreateScanCoordinator(app, args.idle_priority)
        files = app.ProjectFiles(args.exclude)
        outstanding = []
        if app.fRemote is not None:
            files = app.fRemote.Locations(files)
            app.fRemote.Adopt(app.fAnaMgr)
            outstanding.append(app.fRemote.Busy)
        if args.helper:
            app.fHelper = helperproc.CHelperProcessSupport(app.fAnaMgr, str(root))
            app.fHelper.Start()
            coord._UpdateForHelperProcess()
            outstanding.append(app.fHelper.Busy)
        progress = scanreport.MakeProgress(console, args.plain, args.quiet or json_to_stdout)
        tracker = scanreport.CProgressTracker(app, coord, str(root), time.perf_counter())

        def on_status(_coord: object, status: object) -> None:
            progress.Update(tracker.Snapshot(status))

        coord.connect('scan-status-update',
                      timing.fAccount.Wrap(on_status, hostapp.kDisplayTime))
        progress.Start(f'Scanning {scanreport.DisplayPath(str(root))} '
                       f'({len(files):,} files)')
        timing.Call(coord.AddParseablesToQueue, files)
        startup = ProcessAge()
        loop_started = time.perf_counter()
        finished = scanloop.RunUntilDone(outstanding, stop)
        loop_seconds = time.perf_counter() - loop_started
        progress.Stop()
        if stop():
            coord.Quitting()
        cache = app.fAnaMgr.fInfoCache
        cache.WriteToDatabase()
        summary = CollectSummary(app, coord, timing, root, files, db,
                                 startup, loop_seconds, stop.fSignal)
        if not finished and not stop() and summary['outcome'] == 'complete':
            summary['outcome'] = 'stopped'
    finally:
        timing.Uninstall()
        if app.fHelper is not None:
            app.fHelper.destroy()
        app.Shutdown()
        if app.fRemote is not None:
            app.fRemote.Close()
        stop.Uninstall()
    status = ExitStatus(summary)
    summary['exit_status'] = status
    if args.json:
        text = json.dumps(summary, indent=2, ensure_ascii=False)
        if json_to_stdout:
            print(text)
        else:
            Path(args.json).write_text(text + '\n', encoding='utf-8')
    if not json_to_stdout:
        scanreport.PrintSummary(console, summary)
    if summary['database'].get('error'):
        Error(f"results not saved: {summary['database']['error']}")
    return status


def ExitStatus(summary: dict) -> int:
    if summary['database'].get('error'):
        return kExitWriteFailed
    if summary['signal']:
        return 128 + summary['signal']
    return 0


def CollectSummary(app: hostapp.CApplication, coord: object, timing: hostapp.CHostTiming,
                   root: Path, files: list, db: str, startup: float, loop_seconds: float,
                   signum: int | None) -> dict:
    """The figures of the run (see scanreport.PrintSummary for their meaning)."""
    ana_mgr = app.fAnaMgr
    cache = ana_mgr.fInfoCache
    primary, derived = ana_mgr.fPrimaryScanName, ana_mgr.fDerivedScanName
    root_prefix = str(root).rstrip(os.sep) + os.sep

    remote = getattr(app, 'fRemote', None)

    def in_project(loc: object) -> bool:
        return (getattr(loc, 'fPath', '').startswith(root_prefix)
                and (remote is None or isinstance(loc, location.CRemoteFileLocation)))

    def name(loc: object) -> str:
        return scanreport.DisplayPath(getattr(loc, 'fPath', None) or loc.fUrl, str(root))

    scans = {'primary_whole_file': 0, 'primary_single_scope': 0,
             'derived_whole_file': 0, 'derived_single_scope': 0}
    helper = getattr(app, 'fHelper', None)
    scanned = set(helper.fScanned) if helper is not None else set()
    for (loc, scope, scan_name), n in coord._fScanTripleCompletedCount.items():
        kind = 'primary' if scan_name == primary else 'derived' if scan_name == derived else None
        if kind is None:
            continue
        scans[f"{kind}_{'whole_file' if scope == '*' else 'single_scope'}"] += n
        if kind == 'primary':
            scanned.add(loc)
    if helper is not None:
        scans['primary_whole_file'] += len(helper.fScanned)
    scans['total'] = sum(scans.values())
    problems = app.fSingletons.fCacheMgr.fReadProblems
    scanned.difference_update(problems)  # abandoned: the coordinator counts them as done
    up_to_date = {loc for loc, mtime in coord._fMTimeAtLastWholeFileCheck.items()
                  if loc not in scanned and loc not in problems and mtime
                  and cache.GetScanDoneTime(loc, primary) == mtime}
    mimes = dict.fromkeys(files)
    app.fSingletons.fFileAttribMgr.GetMultipleProbableMimeTypes(mimes)
    python = [loc for loc, m in mimes.items() if m in mime.kAnalyzableMimeTypes]
    failed = [{'path': name(loc), 'kind': kind, 'detail': detail}
              for loc, (kind, detail) in problems.items()]
    inspect_failed = remote.fInspectFailed if remote is not None else set()
    failed += [{'path': name(loc), 'kind': 'inspect-failed',
                'detail': 'the remote agent could not inspect it; its scans stay parked'}
               for loc in inspect_failed]
    not_reached = 0
    for loc in python:
        if loc in scanned or loc in up_to_date or loc in problems or loc in inspect_failed:
            continue
        if not loc.GetStat().exists:
            failed.append({'path': name(loc), 'kind': 'vanished',
                           'detail': 'gone before it was scanned'})
        else:
            not_reached += 1
    failed.sort(key=lambda f: f['path'])
    incomplete = coord._fIncompleteScansByLoc
    syntax_errors = sorted(name(loc) for loc in scanned if incomplete.get(loc))
    outside = [loc for loc in scanned | up_to_date if not in_project(loc)]
    t_wall = ProcessAge()
    account = timing.fAccount
    categories = (hostapp.kCoordinatorTime, hostapp.kScannerTime, hostapp.kInfoCacheTime,
                  hostapp.kHostTime, hostapp.kDisplayTime)
    seconds = {c: account.Seconds(c) for c in categories}
    seconds['main loop and the rest'] = max(0.0, t_wall - sum(seconds.values()))
    db_figures: dict = {'path': db, 'error': cache.fDatabaseError,
                        'written_files': cache.fLastWriteCount}
    if not cache.fDatabaseError:
        stats = cache.GetDatabaseStats() or {'files': 0, 'scopes': 0, 'bytes': 0}
        db_figures.update(stats)
        db_figures['bytes_per_file'] = stats['bytes'] / stats['files'] if stats['files'] else 0
        db_figures['bytes_per_scope'] = stats['bytes'] / stats['scopes'] if stats['scopes'] else 0
    outcome = 'interrupted' if signum else 'complete'
    if cache.fDatabaseError:
        outcome = 'results not saved'
    return {
        'project': scanreport.DisplayPath(str(root)),
        'outcome': outcome,
        'signal': signum,
        'files': {
            'in_project': len(files),
            'python': len(python),
            'scanned': sum(1 for loc in scanned if in_project(loc)),
            'up_to_date': sum(1 for loc in up_to_date if in_project(loc)),
            'failed': len(failed),
            'not_reached': not_reached,
            'with_syntax_errors': len(syntax_errors),
            'not_followed': len(app.fSkippedEntries),
        },
        'failed': failed,
        'syntax_errors': syntax_errors,
        'skipped_entries': [{'path': scanreport.DisplayPath(p, str(root)), 'reason': r}
                            for p, r in app.fSkippedEntries],
        'imported_modules': {
            'followed': len(outside),
            'scanned': sum(1 for loc in outside if loc in scanned),
            'up_to_date': sum(1 for loc in outside if loc in up_to_date),
        },
        'scopes_recorded': sum(len(cache.GetScopeInfos(loc)) for loc in scanned),
        'scans': scans,
        'slices': timing.fCallbackCalls.get('_CB_DoIdleAnalysis', 0),
        'time': {
            'wall': t_wall,
            'startup': startup,
            'main_loop': loop_seconds,
            'seconds': seconds,
            'shares': {c: (s / t_wall if t_wall else 0.0) for c, s in seconds.items()},
            'coordinator_share': seconds[hostapp.kCoordinatorTime] / t_wall if t_wall else 0.0,
        },
        'database': db_figures,
        'helper': None if helper is None else {
            'files_scanned': len(helper.fScanned),
            'scopes': sum(helper.fScanned.values()),
            'up_to_date_sent_back': helper.fSentBackUpToDate,
            'sent_back_busy': helper.fSentBackBusy,
            'taken_from_local': helper.fTakenFromLocal,
            'taken_back': helper.fHandedBack,
            'gone': helper.fGoneReason,
        },
        'remote': None if remote is None else {
            'latency': remote.fLatency,
            'inspect_failed': len(inspect_failed),
            'parked_scans': coord._fScanQueue.GetWaitingCount(),
        },
        'peak_rss_bytes': resource.getrusage(resource.RUSAGE_SELF).ru_maxrss * 1024,
    }


if __name__ == '__main__':
    sys.exit(main(sys.argv[1:]))
