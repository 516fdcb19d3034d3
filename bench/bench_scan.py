"""End-to-end benchmark of the main job: ./run scan over a real tree.

    ./run bench scan [--tree DIR] [--repeat N] [--touch FILE] [--follow-stdlib]

The tree (default: the interpreter's standard library without site-packages)
is copied to a temporary directory, so that a file can be changed.  Each
repetition runs the scan command as a separate process, three times:

  full scan        a new database
  unchanged        the same command again: every file is up to date
  touch one file   FILE (relative to the tree; default keyword.py) gets a new
                   top-level name, then the command again: that file is scanned
                   again, and the derived information of the files that use it

and then puts FILE back as it was.  The tree is scanned alone (the imports of
a tree other than the standard library are followed into the standard library
only with --follow-stdlib).  Peak resident memory is the scan process's own
(wait4); the other figures come from the command's --json summary: the
start-up is the time from the process's start to its main loop, the
coordinator's share is the measured self time of its own code (see
hostapp.CHostTiming) over the process's wall time.

Reported: the median of the repetitions, and their range.  Not a test: the
machine may be shared, so compare medians and ratios taken in the same run.
"""
import argparse
import json
import os
import shutil
import statistics
import subprocess
import sys
import sysconfig
import tempfile
import time
from pathlib import Path

ROOT = Path(__file__).resolve().parent.parent
SCAN = [sys.executable, str(ROOT / 'tools' / 'scan.py')]
kTargets = {'bytes per file': ('<', 5 * 1024), 'start-up, unchanged run (s)': ('<', 2.0),
            'unchanged / full wall time': ('<', 0.05), 'coordinator share': ('<', 0.02)}


def CopyTree(src: Path, dst: Path) -> None:
    shutil.copytree(src, dst, symlinks=True,
                    ignore=shutil.ignore_patterns('site-packages', '__pycache__', '*.pyc'))


def RunScan(tree: Path, db: Path, follow: bool) -> tuple[float, int, dict]:
    """(wall seconds, peak RSS bytes, summary) of one run of the command."""
    out = db.with_suffix('.json')
    cmd = [*SCAN, str(tree), '--db', str(db), '--quiet', '--json', str(out)]
    if not follow:
        cmd.append('--no-follow-stdlib')
    started = time.perf_counter()
    proc = subprocess.Popen(cmd, stdout=subprocess.DEVNULL)
    _pid, status, usage = os.wait4(proc.pid, 0)
    wall = time.perf_counter() - started
    proc.returncode = os.waitstatus_to_exitcode(status)
    if proc.returncode != 0:
        sys.exit(f'bench scan: the scan command failed with status {proc.returncode}')
    with open(out) as f:
        summary = json.load(f)
    return wall, usage.ru_maxrss * 1024, summary


def Touch(path: Path) -> str:
    original = path.read_text(encoding='utf-8')
    with open(path, 'a', encoding='utf-8') as f:
        f.write('\n\ndef _bench_touched():\n    return 1\n')
    return original


def OneRepetition(tree: Path, work: Path, touch: Path, follow: bool) -> dict:
    db = work / 'bench.sqlite'
    if db.exists():
        db.unlink()
    figures = {}
    wall, rss, full = RunScan(tree, db, follow)
    scanned = full['files']['scanned'] + full['imported_modules']['scanned']
    figures['full scan: wall (s)'] = wall
    figures['full scan: files scanned (imports included)'] = scanned
    figures['full scan: files per second'] = scanned / wall
    figures['full scan: peak RSS (MB)'] = rss / 2**20
    figures['database size (MB)'] = full['database']['bytes'] / 2**20
    figures['bytes per file'] = full['database']['bytes_per_file']
    figures['bytes per scope'] = full['database']['bytes_per_scope']
    figures['coordinator share'] = full['time']['coordinator_share']
    figures['start-up, full run (s)'] = full['time']['startup']

    wall2, rss2, again = RunScan(tree, db, follow)
    # (Files that cannot be read are tried again each time, and fail again.)
    rescanned = again['files']['scanned'] + again['imported_modules']['scanned']
    if rescanned:
        sys.exit(f'bench scan: the unchanged run scanned {rescanned} files again')
    figures['unchanged: wall (s)'] = wall2
    figures['start-up, unchanged run (s)'] = again['time']['startup']
    figures['unchanged: main loop (s)'] = again['time']['main_loop']
    figures['unchanged: peak RSS (MB)'] = rss2 / 2**20
    figures['unchanged / full wall time'] = wall2 / wall

    original = Touch(touch)
    try:
        wall3, _rss3, touched = RunScan(tree, db, follow)
    finally:
        touch.write_text(original, encoding='utf-8')
    figures['touch one file: wall (s)'] = wall3
    figures['touch one file: files scanned'] = (touched['files']['scanned']
                                                + touched['imported_modules']['scanned'])
    figures['touch one file: derived scans (it and its dependents)'] = \
        touched['scans']['derived_whole_file']
    figures['touch one file: files up to date'] = touched['files']['up_to_date']
    return figures


def main(argv: list[str]) -> int:
    parser = argparse.ArgumentParser(prog='./run bench scan')
    parser.add_argument('--tree', default=sysconfig.get_paths()['stdlib'],
                        help='directory to scan (default: the standard library; '
                        'site-packages and __pycache__ are left out of the copy)')
    parser.add_argument('--repeat', type=int, default=3)
    parser.add_argument('--touch', default='keyword.py',
                        help='file (relative to the tree) changed for the third run')
    parser.add_argument('--follow-stdlib', action='store_true')
    args = parser.parse_args(argv)
    src = Path(args.tree).resolve()
    if not (src / args.touch).is_file():
        sys.exit(f'bench scan: no file {args.touch} in {src} (choose one with --touch)')
    with tempfile.TemporaryDirectory(prefix='bench-scan-') as tmp:
        work = Path(tmp)
        tree = work / 'tree'
        CopyTree(src, tree)
        py_files = sum(1 for _ in tree.rglob('*.py'))
        print(f'tree: copy of {src} ({py_files:,} .py files), {args.repeat} repetition(s); '
              f'changed file: {args.touch}; imports followed into the standard library: '
              f"{'yes' if args.follow_stdlib else 'no'}", flush=True)
        print(f'load average before: {LoadAverage()} ({os.cpu_count()} CPUs)', flush=True)
        runs = []
        for i in range(args.repeat):
            runs.append(OneRepetition(tree, work, tree / args.touch, args.follow_stdlib))
            print(f'  repetition {i + 1}: full {runs[-1]["full scan: wall (s)"]:.1f} s, '
                  f'unchanged {runs[-1]["unchanged: wall (s)"]:.2f} s', flush=True)
    print(f'load average after: {LoadAverage()}')
    if args.repeat == 1:
        print('a single repetition: the figures are one measurement each, not medians')
    print()
    print(f'| figure | median | range (of {args.repeat}) | target |')
    print('|---|---|---|---|')
    for name in runs[0]:
        values = [r[name] for r in runs]
        target = kTargets.get(name)
        target_text = f'{target[0]} {Format(name, target[1])}' if target else ''
        print(f'| {name} | {Format(name, statistics.median(values))} | '
              f'{Format(name, min(values))} to {Format(name, max(values))} | {target_text} |')
    return 0


def LoadAverage() -> str:
    return ', '.join(f'{x:.2f}' for x in os.getloadavg())


def Format(name: str, value: float) -> str:
    if 'share' in name or '/' in name:
        return f'{100 * value:.2f}%'
    if name.startswith('bytes per'):
        return f'{value:,.0f}'
    if isinstance(value, int) or float(value).is_integer():
        return f'{value:,.0f}'
    return f'{value:,.2f}'


if __name__ == '__main__':
    sys.exit(main(sys.argv[1:]))
