"""Full scans with and without the helper process: medians of repeated runs.

    ./run bench helper [--repeat N] [DIR ...]

Each run is a fresh `./run scan DIR --quiet --json` (new database, so every file
is scanned) in its own process; the runs with and without `--helper` alternate
so that both see the same machine load.  Prints, per DIR, the median wall time
of each mode, their ratio, the median processor time (user + system, the
worker's included) and how many files the helper scanned (median).  Wall time
gains need a free core: on a machine busy with other work the helper only adds
its own processor time.
"""
import argparse
import json
import os
import resource
import statistics
import subprocess
import sys
import tempfile
import time
from pathlib import Path

ROOT = Path(__file__).resolve().parent.parent
STDLIB = Path(os.__file__).parent
DEFAULT_DIRS = [str(ROOT / 'standin'), str(STDLIB / 'asyncio'), str(STDLIB / 'email')]


def one_run(directory: str, helper: bool, workdir: str) -> dict:
    db = os.path.join(workdir, 'db.sqlite')
    out = os.path.join(workdir, 'summary.json')
    for path in (db, out):
        if os.path.exists(path):
            os.remove(path)
    cmd = [sys.executable, str(ROOT / 'tools' / 'scan.py'), directory, '--db', db, '--quiet',
           '--json', out] + (['--helper'] if helper else [])
    before = resource.getrusage(resource.RUSAGE_CHILDREN)
    started = time.perf_counter()
    subprocess.run(cmd, check=True, stdout=subprocess.DEVNULL)
    elapsed = time.perf_counter() - started
    after = resource.getrusage(resource.RUSAGE_CHILDREN)
    cpu = (after.ru_utime + after.ru_stime) - (before.ru_utime + before.ru_stime)
    summary = json.loads(Path(out).read_text())
    return {'elapsed': elapsed, 'cpu': cpu, 'wall': summary['time']['wall'],
            'files': summary['database'].get('files', 0),
            'helper_files': (summary['helper'] or {}).get('files_scanned', 0)}


def main() -> None:
    parser = argparse.ArgumentParser()
    parser.add_argument('--repeat', type=int, default=5)
    parser.add_argument('dirs', nargs='*', default=DEFAULT_DIRS)
    args = parser.parse_args()
    print(f'{os.cpu_count()} CPUs, load average {os.getloadavg()[0]:.2f} at start; '
          f'{args.repeat} runs per mode, alternating')
    print(f"{'directory':<12} {'files':>6} {'local s':>8} {'helper s':>9} {'ratio':>6} "
          f"{'local cpu s':>12} {'helper cpu s':>13} {'by helper':>10}")
    with tempfile.TemporaryDirectory() as workdir:
        for directory in args.dirs:
            runs: dict[bool, list[dict]] = {False: [], True: []}
            for _ in range(args.repeat):
                for helper in (False, True):
                    runs[helper].append(one_run(directory, helper, workdir))
            local = statistics.median(r['elapsed'] for r in runs[False])
            with_helper = statistics.median(r['elapsed'] for r in runs[True])
            by_helper = statistics.median(r['helper_files'] for r in runs[True])
            cpu = [statistics.median(r['cpu'] for r in runs[h]) for h in (False, True)]
            files = runs[False][0]['files']
            print(f'{Path(directory).name:<12} {files:>6} {local:>8.2f} {with_helper:>9.2f} '
                  f'{with_helper / local:>6.2f} {cpu[0]:>12.2f} {cpu[1]:>13.2f} '
                  f'{by_helper:>10.0f}', flush=True)
    print(f'load average {os.getloadavg()[0]:.2f} at the end')


if __name__ == '__main__':
    main()
