"""What the main job shows: the progress while it scans and the summary at the end.

Progress is fed by the coordinator's "scan-status-update" (once a second while
work is queued).  ``MakeProgress`` picks the form: a live ``rich`` display on a
terminal, one plain line per update otherwise (or with ``--plain``), nothing
with ``--quiet``.  Each update is turned into a ``CProgress`` snapshot first; a
display only lays out its rows, so a new figure (work in a helper process, say)
is one more row, not a new display.

The summary is one dictionary (``CollectSummary``) that is printed as a table
(``PrintSummary``) or written as JSON for scripts; both come from the same
figures.
"""
from __future__ import annotations

import collections
import os
import sys
import time
from dataclasses import dataclass, field
from typing import Any

from rich import box
from rich.console import Console, Group
from rich.live import Live
from rich.progress_bar import ProgressBar
from rich.table import Table
from rich.text import Text

kRateWindow = 10.0   # seconds of history behind the scans-per-second figure
kFirstFew = 5        # failed or skipped files named in the summary table


def DisplayPath(path: str, root: str | None = None) -> str:
    """A printable path: relative to ``root`` when inside it, undecodable bytes
    shown as U+FFFD (file names need not be UTF-8)."""
    if root and (path == root or path.startswith(root.rstrip(os.sep) + os.sep)):
        path = os.path.relpath(path, root)
    return path.encode('utf-8', 'surrogateescape').decode('utf-8', 'replace')


def FormatSeconds(seconds: float | None) -> str:
    if seconds is None:
        return 'unknown'
    if seconds < 60:
        return f'{seconds:.1f} s'
    minutes, secs = divmod(round(seconds), 60)
    if minutes < 60:
        return f'{minutes} min {secs:02d} s'
    hours, minutes = divmod(minutes, 60)
    return f'{hours} h {minutes:02d} min'


def FormatBytes(n: float) -> str:
    for unit in ('B', 'KB', 'MB', 'GB'):
        if abs(n) < 1024 or unit == 'GB':
            return f'{n:,.0f} {unit}' if unit == 'B' else f'{n:,.1f} {unit}'
        n /= 1024
    return f'{n:,.1f} GB'


# -- progress -------------------------------------------------------------------------


@dataclass
class CQueueRow:
    """One line of the progress table: a kind of scan, or other queued work."""

    label: str
    done: int | None
    left: int
    detail: str = ''


@dataclass
class CProgress:
    elapsed: float
    rows: list[CQueueRow]
    done: int
    left: int
    scans_per_second: float | None
    eta: float | None
    current: str = ''
    extra: dict[str, Any] = field(default_factory=dict)


class CProgressTracker:
    """Turns status records into ``CProgress`` snapshots.

    ``done`` counts come from the information cache's record of completed scans
    per scan name; ``left`` from the status record (files per queue, and the
    files waiting for data)."""

    def __init__(self, app: Any, coord: Any, root: str, started: float) -> None:
        self.fApp = app
        self.fCoord = coord
        self.fRoot = root
        self.fStarted = started
        self._fHistory: collections.deque[tuple[float, int]] = collections.deque()

    def Snapshot(self, status: Any) -> CProgress:
        now = time.perf_counter()
        ana_mgr = self.fApp.fAnaMgr
        finished = ana_mgr.fInfoCache.fFinishedScans
        names = [ana_mgr.fPrimaryScanName, ana_mgr.fDerivedScanName]
        left_by_name: dict[str, dict[int, int]] = {}
        for q in status.queue_status_list:
            left_by_name.setdefault(q.scan_name, {})[q.priority] = q.file_count
            if q.scan_name not in names:
                names.append(q.scan_name)
        rows = []
        for name in names:
            by_priority = left_by_name.get(name, {})
            left = sum(by_priority.values())
            detail = ' · '.join(f'p{p} {n:,}' for p, n in sorted(by_priority.items()) if n)
            rows.append(CQueueRow(ScanLabel(ana_mgr, name), sum(finished.get(name, (0, 0))),
                                  left, detail))
        rows.append(CQueueRow('waiting for data', None, status.waiting_count))
        helper = getattr(self.fApp, 'fHelper', None)
        if helper is not None:
            rows.append(CQueueRow('in the helper process', len(helper.fScanned),
                                  len(helper._fPending),
                                  f'gone: {helper.fGoneReason}' if helper.fGoneReason else ''))
        done = sum(sum(v) for v in finished.values())
        left = sum(r.left for r in rows)
        history = self._fHistory
        history.append((now, done))
        while len(history) > 2 and now - history[0][0] > kRateWindow:
            history.popleft()
        rate = None
        if len(history) >= 2 and history[-1][0] > history[0][0]:
            rate = (history[-1][1] - history[0][1]) / (history[-1][0] - history[0][0])
        eta = left / rate if rate else None
        return CProgress(now - self.fStarted, rows, done, left, rate, eta, self.Current())

    def Current(self) -> str:
        loc = self.fCoord._CScanCoordinator__fActiveLoc
        if loc is None:
            loc = self.fApp.fAnaMgr.fInfoCache.fLastFinished
        path = getattr(loc, 'fPath', None) or getattr(loc, 'fUrl', '')
        return DisplayPath(path, self.fRoot) if path else ''


def ScanLabel(ana_mgr: Any, scan_name: str) -> str:
    if scan_name == ana_mgr.fPrimaryScanName:
        return 'primary scans'
    if scan_name == ana_mgr.fDerivedScanName:
        return 'derived scans'
    return scan_name


class CPlainProgress:
    """One line per status update."""

    def __init__(self, out: Any = None) -> None:
        self.fOut = out if out is not None else sys.stdout

    def Start(self, title: str) -> None:
        print(title, file=self.fOut, flush=True)

    def Update(self, p: CProgress) -> None:
        parts = []
        for row in p.rows:
            label = row.label.removesuffix(' scans')
            if row.done is None:
                parts.append(f'{label} {row.left:,}')
            else:
                parts.append(f'{label} {row.done:,} done, {row.left:,} left')
        rate = f'{p.scans_per_second:,.0f} scans/s' if p.scans_per_second is not None else '- scans/s'
        parts.append(rate)
        parts.append(f'about {FormatSeconds(p.eta)} left' if p.eta is not None else 'time left unknown')
        if p.current:
            parts.append(p.current)
        print(f'[{p.elapsed:7.1f}s] ' + ' · '.join(parts), file=self.fOut, flush=True)

    def Stop(self) -> None:
        pass


class CQuietProgress:
    def Start(self, title: str) -> None:
        pass

    def Update(self, p: CProgress) -> None:
        pass

    def Stop(self) -> None:
        pass


class CLiveProgress:
    """A live table on the terminal, redrawn at each update (no drawing thread)."""

    def __init__(self, console: Console) -> None:
        self.fConsole = console
        self.fTitle = ''
        self._fLive: Live | None = None

    def Start(self, title: str) -> None:
        self.fTitle = title
        self._fLive = Live(Text(title + ' (starting)'), console=self.fConsole,
                           auto_refresh=False, transient=True)
        self._fLive.start()

    def Update(self, p: CProgress) -> None:
        if self._fLive is not None:
            self._fLive.update(self.Render(p), refresh=True)

    def Render(self, p: CProgress) -> Group:
        table = Table(box=box.SIMPLE_HEAD, show_edge=False, pad_edge=False)
        table.add_column('queue')
        table.add_column('done', justify='right')
        table.add_column('left', justify='right')
        table.add_column('left by priority', style='dim')
        for row in p.rows:
            table.add_row(row.label, '' if row.done is None else f'{row.done:,}',
                          f'{row.left:,}', row.detail)
        total = p.done + p.left
        bar = ProgressBar(total=max(total, 1), completed=p.done, width=50)
        rate = f'{p.scans_per_second:,.0f} scans/s' if p.scans_per_second is not None else '- scans/s'
        eta = f'about {FormatSeconds(p.eta)} left' if p.eta is not None else 'time left unknown'
        line = Text.assemble((self.fTitle, 'bold'), '  ', f'{FormatSeconds(p.elapsed)} elapsed')
        figures = Text(f'{rate} · {eta}')
        current = Text(f'now: {p.current}', style='cyan', overflow='ellipsis', no_wrap=True)
        return Group(line, bar, table, figures, current)

    def Stop(self) -> None:
        if self._fLive is not None:
            self._fLive.stop()
            self._fLive = None


def MakeProgress(console: Console, plain: bool, quiet: bool) -> Any:
    if quiet:
        return CQuietProgress()
    if plain or not console.is_terminal:
        return CPlainProgress()
    return CLiveProgress(console)


# -- summary -------------------------------------------------------------------------


def _AddNamedRows(table: Table, label: str, figure: str, names: list[str], style: str) -> None:
    """A row with a count, then the first few of what it counts, one per row."""
    table.add_row(label, figure)
    for name in names[:kFirstFew]:
        table.add_row('', Text(name, style=style))
    if len(names) > kFirstFew:
        table.add_row('', f'... and {len(names) - kFirstFew:,} more')


def PrintSummary(console: Console, s: dict[str, Any]) -> None:
    """The summary table (see ``CollectSummary`` for the figures)."""
    files = s['files']
    table = Table(title=f"Scan of {s['project']}: {s['outcome']}", box=box.ROUNDED,
                  show_header=False, title_justify='left')
    table.add_column(style='bold')
    table.add_column()
    table.add_row('files in the project', f"{files['in_project']:,} ({files['python']:,} Python)")
    table.add_row('scanned', f"{files['scanned']:,}")
    table.add_row('skipped as up to date', f"{files['up_to_date']:,}")
    if files['not_reached']:
        table.add_row('not reached', f"{files['not_reached']:,}")
    failed = s['failed']
    kinds = collections.Counter(f['kind'] for f in failed)
    _AddNamedRows(table, 'failed', f'{len(failed):,}' + (
        ' (' + ', '.join(f'{k} {n:,}' for k, n in sorted(kinds.items())) + ')' if failed else ''),
        [f"{f['path']}: {f['kind']} ({f['detail']})" for f in failed], 'red')
    errors = s['syntax_errors']
    if errors:
        _AddNamedRows(table, 'with syntax errors',
                      f'{len(errors):,} (scanned; scopes marked incomplete)', errors, 'yellow')
    skipped = s['skipped_entries']
    if skipped:
        _AddNamedRows(table, 'not followed', f'{len(skipped):,} links or special files',
                      [f"{e['path']}: {e['reason']}" for e in skipped], 'yellow')
    imp = s['imported_modules']
    table.add_row('imported modules followed',
                  f"{imp['followed']:,} outside the project ({imp['scanned']:,} scanned, "
                  f"{imp['up_to_date']:,} up to date)")
    table.add_row('scopes recorded', f"{s['scopes_recorded']:,} this run")
    sc = s['scans']
    table.add_row('scans', f"{sc['total']:,}: primary {sc['primary_whole_file']:,} whole-file + "
                  f"{sc['primary_single_scope']:,} single-scope, derived "
                  f"{sc['derived_whole_file']:,} whole-file + {sc['derived_single_scope']:,} "
                  f"single-scope")
    table.add_row('slices run', f"{s['slices']:,}")
    t = s['time']
    table.add_row('wall time', f"{FormatSeconds(t['wall'])} (start-up {FormatSeconds(t['startup'])},"
                  f" main loop {FormatSeconds(t['main_loop'])})")
    shares = ', '.join(f"{name} {100 * t['shares'][name]:.1f}%" for name in t['shares'])
    table.add_row('where the time went', shares)
    table.add_row('', Text('coordinator: its own code, measured as the time in its callbacks '
                           'and calls minus the time in the host services they call',
                           style='dim'))
    db = s['database']
    if db.get('error'):
        table.add_row('database', Text(f"{db['path']}: NOT WRITTEN: {db['error']}", style='bold red'))
    elif db.get('files') is not None:
        table.add_row('database', f"{db['path']}")
        table.add_row('', f"{db['files']:,} files, {db['scopes']:,} scopes, "
                      f"{FormatBytes(db['bytes'])} ({FormatBytes(db['bytes_per_file'])} per file, "
                      f"{db['bytes_per_scope']:,.0f} B per scope)")
    helper = s.get('helper')
    if helper:
        table.add_row('helper process', f"{helper['files_scanned']:,} files scanned "
                      f"({helper['scopes']:,} scopes), {helper['taken_from_local']:,} taken from "
                      f"the local queue, {helper['sent_back_busy']:,} left to it while busy")
        if helper['gone']:
            table.add_row('', Text(f"gone: {helper['gone']}; {helper['taken_back']:,} unfinished "
                                   'files taken back into the local queue', style='yellow'))
    remote = s.get('remote')
    if remote:
        table.add_row('remote files', f"latency {remote['latency']:g} s, "
                      f"{remote['inspect_failed']:,} failed inspections, "
                      f"{remote['parked_scans']:,} scans left parked")
    table.add_row('peak memory', FormatBytes(s['peak_rss_bytes']))
    console.print(table)
    if s['outcome'] == 'interrupted':
        console.print('Interrupted: the results so far are saved; run the same command again '
                      'to go on (stored files are skipped).')
