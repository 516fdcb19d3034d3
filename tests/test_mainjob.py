"""The main job as a product: the database, the scan command, bad input, interruption."""
import io
import json
import os
import re
import signal
import sqlite3
import subprocess
import sys
import time
import types

import hostapp
import pytest
from guiutils import ostrelgtk
from ostrelbase import location

from pysource import scopeinfo, scopescanner

SOURCE = '''\
import os.path
from . import helper
from helper import make as mk
from helper import *


class Shape(Base):
    sides = [1, 2]

    def __init__(self, w, h=3):
        self.w = w

    def area(self):
        def inner():
            return mk(1)
        return inner


def f():
    pass


def f():
    return "caf\\u00e9; {x"
'''


def make_tree(root):
    """A small project: imports, classes, redefinitions, a syntax error, odd names."""
    root.mkdir()
    (root / 'helper.py').write_text('def make(s):\n    return s\n')
    (root / 'mod.py').write_text(SOURCE)
    (root / 'broken.py').write_text('def ok():\n    return 1\n\ndef bad(:\n    pass\n')
    (root / 'with space é.py').write_text('import mod\nX = mod.Shape(1)\n')
    return root


def scan_in_process(root, db):
    """The whole job in this process: returns (app, coordinator)."""
    app = hostapp.CreateApplication(str(root), db_path=str(db), python_path=[str(root)])
    coord = hostapp.CreateScanCoordinator(app)
    coord.AddParseablesToQueue(app.ProjectFiles())
    assert ostrelgtk.run_until_idle(100_000)
    return app, coord


@pytest.fixture
def fresh_loop():
    ostrelgtk.reset()
    location.ResetForTests()
    yield
    ostrelgtk.reset()
    location.ResetForTests()


def answers(cache, locs):
    """Every answer the coordinator, scanners and query tool get from the cache."""
    out = []
    for loc in locs:
        out.append(('imports', cache.GetAllImports([loc])))
        mtime = loc.GetMTime()
        out.append(('done', cache.GetScansDoneForMultipleFiles({loc: mtime})))
        out.append(('dependents', sorted(cache.GetDependents(loc))))
        infos = cache.GetScopeInfos(loc)
        out.append(('scopes', list(infos)))
        for name in infos:
            info = cache.GetScopeInfo(loc, name)
            k = info.key
            out.append((name, k.loc.fUrl, k.scope_name, k.scan_name, k.def_loc.fUrl,
                        k.def_scope_name, info.def_info, info.disk_mtime, info.incomplete,
                        info.does_not_exist, list(info.type_equivs.items()),
                        cache.GetDerivedInfo(loc, name)))
    return out


def test_database_round_trip_gives_the_same_answers(tmp_path, fresh_loop):
    root = make_tree(tmp_path / 'proj')
    db = tmp_path / 'db.sqlite'
    app, coord = scan_in_process(root, db)
    cache = app.fAnaMgr.fInfoCache
    mod = app.fProjectDir.Join('mod.py')
    # Stored without a whole-file scan: an instance scope, a class known not to
    # exist, and a scope whose definition no longer matches its parent's record.
    assert coord.TryToScanNow(mod, 'Shape()', None, time.time() + 10) is not None
    assert coord.BuildInstanceScopeNoScanning(mod, 'Nope()', 0).does_not_exist
    (root / 'mod.py').write_text(SOURCE.replace('class Shape', '\n\nclass Shape'))
    scanner = scopescanner.CSingleScopePrimaryScanner(mod, 'Shape.area')
    scanner.Scan(time.time() + 10)
    assert scanner.SaveToInfoCache()
    scanner.destroy()
    assert cache.WriteToDatabase() > 0 and cache.fDatabaseError is None
    locs = sorted(cache.GetKnownLocations())
    assert len(locs) == 5  # with the builtins stub
    before = answers(cache, locs)
    spaced = app.fProjectDir.Join('with space é.py')
    assert cache.GetDependents(mod) == {spaced}
    app.Shutdown()

    for _round in range(2):
        fresh = scopeinfo.CInfoCache('scope-primary', 'scope-derived', str(db))
        try:
            assert fresh.LoadFromDatabase() == 5
            # The whole-file check's import query reads nothing but the import index.
            fresh.GetAllImports(locs)
            assert len(fresh._fUnread) == 5
            assert answers(fresh, locs) == before
            # A file read back and written again keeps the dependencies it had.
            fresh.SetDerivedInfo(spaced, '', fresh.GetDerivedInfo(spaced, ''))
            assert fresh.WriteToDatabase() == 1
        finally:
            fresh.destroy()


# -- the scan command ------------------------------------------------------------------

ROOT = os.path.dirname(os.path.dirname(os.path.abspath(__file__)))
EXT = os.environ.get('PYSOURCE_EXT_DIR', os.path.join(ROOT, 'build', 'ext'))
ENV = dict(os.environ, PYTHONPATH=os.pathsep.join([os.path.join(ROOT, 'standin'), EXT]))
SCAN = [sys.executable, os.path.join(ROOT, 'tools', 'scan.py')]


def read_json(path):
    with open(path) as f:
        return json.load(f)


def run_scan(root, db, *extra, timeout=120):
    """Run the command; returns (exit status, summary figures or None, stdout, stderr)."""
    out = os.path.join(os.path.dirname(str(db)), 'summary.json')
    if os.path.exists(out):
        os.remove(out)
    proc = subprocess.run([*SCAN, str(root), '--db', str(db), '--no-follow-stdlib', '--plain',
                           '--json', out, *extra], env=ENV, capture_output=True, text=True,
                          timeout=timeout, check=False)
    summary = read_json(out) if os.path.exists(out) else None
    return proc.returncode, summary, proc.stdout, proc.stderr


def test_rerun_skips_unchanged_files_and_rescans_what_depends_on_a_change(tmp_path):
    root = make_tree(tmp_path / 'proj')
    db = tmp_path / 'db.sqlite'
    status, first, out, err = run_scan(root, db)
    assert status == 0 and first['outcome'] == 'complete', err
    assert first['files'] | {'scanned': 4, 'up_to_date': 0, 'failed': 0} == first['files']
    assert first['syntax_errors'] == ['broken.py']
    # The builtins stub too, without derived information (it is not the project's).
    assert (first['scans']['primary_whole_file'], first['scans']['derived_whole_file']) == (5, 4)
    assert first['database']['files'] == 5 and first['database']['scopes'] > 15
    assert 'scanned' in out and 'Traceback' not in out + err

    status, second, _out, _err = run_scan(root, db)
    assert status == 0
    assert (second['files']['scanned'], second['files']['up_to_date']) == (0, 4)
    assert second['scans']['total'] == 0 and second['database'] == first['database'] | {
        'written_files': 0}

    # A new name in mod.py: mod.py is scanned again, and the derived information
    # of the file that imports it; nothing else.
    with open(root / 'mod.py', 'a') as f:
        f.write('\n\ndef added():\n    return 1\n')
    status, third, _out, _err = run_scan(root, db)
    assert (third['files']['scanned'], third['files']['up_to_date']) == (1, 3)
    assert third['scans'] | {'primary_whole_file': 1, 'derived_whole_file': 2} == third['scans']


def test_progress_figures_per_queue_rate_over_recent_history_and_time_left(monkeypatch):
    sys.path.insert(0, os.path.join(ROOT, 'tools'))
    import scanreport
    ns = types.SimpleNamespace
    finished = {}
    cache = ns(fFinishedScans=finished, fLastFinished=location.CLocalFileLocation('/r/b.py'))
    app = ns(fAnaMgr=ns(fInfoCache=cache, fPrimaryScanName='p', fDerivedScanName='d'))
    coord = ns(_CScanCoordinator__fActiveLoc=location.CLocalFileLocation('/r/sub/a.py'))
    clock = iter([10.0, 11.0, 13.0, 30.0])
    monkeypatch.setattr(scanreport.time, 'perf_counter', lambda: next(clock))
    tracker = scanreport.CProgressTracker(app, coord, '/r', 9.0)

    def snapshot(primary_done, derived_done):
        finished.update(p=[primary_done, 1], d=[derived_done, 0])
        queues = [ns(scan_name='p', priority=1, file_count=3),
                  ns(scan_name='p', priority=2, file_count=7),
                  ns(scan_name='d', priority=2, file_count=5)]
        return tracker.Snapshot(ns(queue_status_list=queues, waiting_count=2))

    first = snapshot(0, 0)
    assert (first.done, first.left, first.scans_per_second, first.eta) == (1, 17, None, None)
    second = snapshot(3, 1)
    assert [(r.label, r.done, r.left, r.detail) for r in second.rows] == [
        ('primary scans', 4, 10, 'p1 3 · p2 7'), ('derived scans', 1, 5, 'p2 5'),
        ('waiting for data', None, 2, '')]
    assert (second.elapsed, second.scans_per_second, second.eta) == (2.0, 4.0, 17 / 4)
    assert second.current == 'sub/a.py'
    out = io.StringIO()
    scanreport.CPlainProgress(out).Update(second)
    assert out.getvalue() == ('[    2.0s] primary 4 done, 10 left · derived 1 done, 5 left · '
                              'waiting for data 2 · 4 scans/s · about 4.2 s left · sub/a.py\n')
    snapshot(9, 5)
    coord._CScanCoordinator__fActiveLoc = None  # between two files: the last one finished
    last = snapshot(20, 8)  # the rate forgets what is older than its window
    assert (last.scans_per_second, last.current) == ((29 - 15) / (30 - 13), 'b.py')


def many_files(root, count):
    """A tree that takes a few seconds to scan."""
    root.mkdir()
    body = ''.join(f'class C{i}:\n    def m(self, a, b=2):\n        self.y = a + b\n'
                   f'        return os.path.join(str(a), "x")\n\n\ndef f{i}(v):\n'
                   f'    return C{i}().m(v)\n\n\n' for i in range(25))
    for i in range(count):
        (root / f'm{i:03d}.py').write_text(f'import os\nfrom m000 import C0\n\n\n{body}')


def test_a_signal_stops_the_scan_cleanly_and_the_next_run_goes_on(tmp_path):
    """SIGINT stops the first run, SIGTERM the second (which resumes the first);
    a third run finishes what is left."""
    root, db = tmp_path / 'proj', tmp_path / 'db.sqlite'
    # Primary scans of a few hundred of these files take about a second here:
    # enough that the first progress line comes well before the last one.
    count = 1000
    many_files(root, count)
    prefix = f'file://{root}/'.encode()
    stored_before = 0
    for run, signum in enumerate((signal.SIGINT, signal.SIGTERM)):
        out = tmp_path / f'run{run}.json'
        proc = subprocess.Popen([*SCAN, str(root), '--db', str(db), '--no-follow-stdlib',
                                 '--plain', '--json', str(out)], env=ENV,
                                stdout=subprocess.PIPE, stderr=subprocess.PIPE, text=True)
        try:
            # Progress lines come once a second: stop it once some files are done.
            for line in proc.stdout:
                found = re.search(r'primary (\d+) done', line)
                if found and int(found.group(1)) > 5:
                    break
            else:
                raise AssertionError(proc.stderr.read())
            proc.send_signal(signum)
            stdout, stderr = proc.communicate(timeout=60)
        finally:
            proc.kill()
        assert proc.returncode == 128 + signum, stderr
        assert 'Traceback' not in stdout + stderr and 'Interrupted' in stdout
        summary = read_json(out)
        assert summary['outcome'] == 'interrupted'
        with sqlite3.connect(db) as conn:
            assert conn.execute('PRAGMA integrity_check').fetchone() == ('ok',)
            urls = [bytes(u) for (u,) in conn.execute('SELECT url FROM files')]
        stored = sum(1 for u in urls if u.startswith(prefix))
        assert stored_before < stored < count
        assert summary['files']['up_to_date'] == stored_before
        assert summary['files']['not_reached'] == count - stored
        stored_before = stored

    status, last, _out, err = run_scan(root, db)
    assert status == 0, err
    assert last['files']['up_to_date'] == stored
    assert last['files']['scanned'] == last['scans']['primary_whole_file'] == count - stored


# -- bad input ---------------------------------------------------------------------------

def bad_tree(root):
    root.mkdir()
    (root / 'good.py').write_text('import helper\nX = helper.make(1)\n')
    (root / 'helper.py').write_text('def make(s):\n    return s\n')
    (root / 'latin.py').write_bytes(b'# -*- coding: utf-8 -*-\nS = "caf\xe9"\n')
    (root / 'nul.py').write_bytes(b'A = 1\nB = "\x00"\n\ndef f():\n    return A\n')
    (root / 'syntax.py').write_text('def ok():\n    return 1\n\ndef bad(:\n    pass\n')
    (root / 'locked.py').write_text('Z = 1\n')
    (root / 'gone.py').write_text('G = 1\n')
    (root / 'changed.py').write_text('OLD = 1\n')
    (root / 'dir with space').mkdir()
    (root / 'dir with space' / 'é ünïcode.py').write_text('U = "ü"\n')
    (root / os.fsdecode(b'bad\xffname.py')).write_text('V = (\n')
    os.symlink('.', root / 'dir with space' / 'loop')
    os.symlink('l2.py', root / 'l1.py')
    os.symlink('l1.py', root / 'l2.py')
    os.symlink('nowhere.py', root / 'broken.py')
    os.mkfifo(root / 'pipe.py')


def test_bad_files_are_skipped_and_counted_and_nothing_else_is_lost(tmp_path, monkeypatch,
                                                                   capsys, fresh_loop):
    sys.path.insert(0, os.path.join(ROOT, 'tools'))
    import scan
    root, db, out = tmp_path / 'proj', tmp_path / 'db.sqlite', tmp_path / 's.json'
    bad_tree(root)
    # Unreadable for root too (permissions are not enough here).
    real_read = location.CLocalFileLocation.ReadBytes

    def read(loc):
        if loc.fPath.endswith('locked.py'):
            raise PermissionError(13, 'Permission denied')
        return real_read(loc)
    monkeypatch.setattr(location.CLocalFileLocation, 'ReadBytes', read)
    # Between queueing and scanning: one file vanishes, one changes.
    real_run = scan.ostrelgtk.run_until_idle

    def run(*args):
        (root / 'gone.py').unlink()
        (root / 'changed.py').write_text('NEW = 2\n')
        return real_run(*args)
    monkeypatch.setattr(scan.ostrelgtk, 'run_until_idle', run)
    assert scan.main([str(root), '--db', str(db), '--no-follow-stdlib', '--quiet',
                      '--json', str(out)]) == 0
    s = read_json(out)
    assert {f['path']: f['kind'] for f in s['failed']} == {
        'gone.py': 'vanished', 'latin.py': 'undecodable', 'locked.py': 'unreadable'}
    assert s['syntax_errors'] == ['bad\ufffdname.py', 'nul.py', 'syntax.py']
    assert sorted((e['path'], e['reason']) for e in s['skipped_entries']) == [
        ('broken.py', 'broken symbolic link'),
        ('dir with space/loop', 'symbolic link to a directory (not followed)'),
        ('l1.py', 'symbolic link loop'), ('l2.py', 'symbolic link loop'),
        ('pipe.py', 'not a regular file')]
    assert s['files']['scanned'] == 7 and s['files']['not_reached'] == 0
    printed = capsys.readouterr()
    assert 'bad\ufffdname.py' in printed.out and 'Traceback' not in printed.out + printed.err

    monkeypatch.setattr(scan.ostrelgtk, 'run_until_idle', real_run)
    assert scan.main([str(root), '--db', str(db), '--no-follow-stdlib', '--quiet',
                      '--json', str(out)]) == 0
    again = read_json(out)
    assert again['files']['up_to_date'] == 7 and again['files']['scanned'] == 0
    cache = scopeinfo.CInfoCache('scope-primary', 'scope-derived', str(db))
    cache.LoadFromDatabase()
    changed = location.CLocalFileLocation(str(root / 'changed.py'))
    assert list(cache.GetScopeInfo(changed, '').type_equivs) == ['NEW']
    cache.destroy()


def garbage(db):
    db.write_bytes(b'not a database at all' * 100)


def read_only(db):
    db.write_bytes(b'')
    db.chmod(0o444)


@pytest.mark.parametrize('arrange, status, message', [
    (lambda tmp: str(tmp / 'missing'), 2, 'scan: no such directory: '),
    (lambda tmp: str(tmp / 'proj' / 'helper.py'), 2, 'scan: not a directory: '),
    (garbage, 2, 'scan: not a database written by this tool: '),
    (read_only, 2, 'scan: database is read-only: '),
    ('BEGIN EXCLUSIVE', 2, 'scan: database is locked by another process: '),
    ('BEGIN IMMEDIATE', 1, 'scan: results not saved: database is locked by another process: '),
])
def test_bad_directory_or_database_gives_one_line(tmp_path, arrange, status, message):
    root, db = make_tree(tmp_path / 'proj'), tmp_path / 'db.sqlite'
    target = root
    conn = None
    if isinstance(arrange, str):
        assert run_scan(root, db)[0] == 0
        (root / 'helper.py').write_text('def make(s):\n    return [s]\n')  # to be written
        conn = sqlite3.connect(db, isolation_level=None)
        conn.execute(arrange)  # another process holds the lock meanwhile
    elif arrange in (garbage, read_only):
        arrange(db)
        before = db.read_bytes()
    else:
        target = arrange(tmp_path)
    try:
        got, _summary, out, err = run_scan(target, db, timeout=60)
    finally:
        if conn is not None:
            conn.close()
    assert got == status
    lines = err.strip().splitlines()
    assert len(lines) == 1 and lines[0].startswith(message), err
    assert 'Traceback' not in out
    if arrange in (garbage, read_only):
        assert db.read_bytes() == before


def test_module_lookup_through_listings_finds_what_stat_finds(tmp_path, fresh_loop):
    """The factory tries candidate files against cached directory listings; the
    answers must be those of asking the file system for each candidate."""
    from pysource import analysismgr
    for rel in ('a.py', 'a.pyi', 'p/__init__.py', 'p/q.pyi', 'p/r/__init__.pyi', 's.so',
                'stub_only.pyi', 'd.py/__init__.py', 'p/a.py'):
        (tmp_path / rel).parent.mkdir(parents=True, exist_ok=True)
        (tmp_path / rel).write_text('')
    os.symlink('missing', tmp_path / 'gone.py')
    os.symlink('p', tmp_path / 'linked')
    app = hostapp.CreateApplication(str(tmp_path / 'p'), db_path=None,
                                    python_path=[str(tmp_path)])
    factory = app.fAnaMgr.fAnalysisFactory
    names = ['a', 'p', 'p.q', 'p.r', 'p.a', 's', 'stub_only', 'd', 'd.py', 'gone', 'linked.q',
             'linked', 'nothing', 'p.nothing', '', 'a..b', 'p.r.x']
    for dirloc in (None, app.fProjectDir, app.fProjectDir.Join('r')):
        for name in names:
            for ext in (False, True):
                for base in factory._SearchDirs(dirloc):
                    expected = next((c for c in factory._Candidates(base, name, ext)
                                     if analysismgr._Exists(c)), None)
                    assert factory._FindIn(base, name, ext) == expected, (base, name, ext)
    app.Shutdown()
