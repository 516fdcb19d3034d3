"""Remote project files and the helper process, through the main loop and the scan job."""
import json
import os
import signal
import sys
import time

import hostapp
import pytest
import remoteproject
import scanloop
from guiutils import ostrelgtk
from ostrelbase import location, remoteclient

from pysource import helperproc, scopescanner

sys.path.insert(0, os.path.join(os.path.dirname(os.path.dirname(__file__)), 'tools'))
import scan


@pytest.fixture
def fresh_loop():
    ostrelgtk.reset()
    location.ResetForTests()
    yield
    remoteclient.UnregisterAll()
    ostrelgtk.reset()
    location.ResetForTests()


def make_tree(root, n=3, big=None):
    """A package and n modules, each importing the one before it; module ``big``
    is long (slow to scan)."""
    (root / 'pkg').mkdir(parents=True)
    (root / 'pkg' / '__init__.py').write_text('from .base import Base\n')
    (root / 'pkg' / 'base.py').write_text('class Base:\n    def run(self):\n        return 1\n')
    for i in range(n):
        body = f'from pkg import Base\nimport m{i - 1}\n' if i else 'from pkg import Base\n'
        body += f'\n\nclass C{i}(Base):\n    def run(self):\n        return {i}\n'
        functions = 3000 if i == big else 20
        body += ''.join(f'\n\ndef f{j}(x):\n    return C{i}().run() + x\n'
                        for j in range(functions))
        (root / f'm{i}.py').write_text(body)
    return root


def run_job(root, db, *extra):
    """The scan job in this process; returns its JSON summary."""
    out = db.with_suffix('.json')
    started = time.monotonic()
    status = scan.main([str(root), '--db', str(db), '--no-follow-stdlib', '--quiet',
                        '--json', str(out), *extra])
    summary = json.loads(out.read_text())
    assert status == 0 and summary['outcome'] == 'complete'
    assert time.monotonic() - started < 60
    return summary


# -- remote files ------------------------------------------------------------------------


def test_remote_scan_parks_waits_and_stores_what_a_local_scan_stores(
        tmp_path, fresh_loop, monkeypatch):
    root = make_tree(tmp_path / 'proj')
    local = run_job(root, tmp_path / 'local.sqlite')
    released, resumed, finished = [], [], []
    watch = remoteproject.CRemoteProject.Adopt

    def adopt(self, ana_mgr):
        watch(self, ana_mgr)
        ana_mgr.fLocationDataCache.connect('now-tree-branch-ready',
                                           lambda _c, locs: released.extend(locs))
        finish = ana_mgr.fInfoCache.FinishedWithScans

        def finished_with(loc, scope, scan_name):
            if scan_name == ana_mgr.fPrimaryScanName:
                finished.append(loc.GetBaseName())
            return finish(loc, scope, scan_name)
        monkeypatch.setattr(ana_mgr.fInfoCache, 'FinishedWithScans', finished_with)

    data_arrived = scopescanner.CScanner._CB_DataArrived

    def on_data(scanner, abort):
        resumed.append(scanner.fLocation.GetBaseName())
        data_arrived(scanner, abort)

    monkeypatch.setattr(remoteproject.CRemoteProject, 'Adopt', adopt)
    monkeypatch.setattr(scopescanner.CScanner, '_CB_DataArrived', on_data)
    remote = run_job(root, tmp_path / 'remote.sqlite', '--remote-latency', '0.05')

    names = ['base.py', '__init__.py', 'm0.py', 'm1.py', 'm2.py']
    # Every file's work was parked, released when its inspection arrived, and its
    # scanner waited for the contents; released files are scanned in queued order.
    assert sorted(loc.GetBaseName() for loc in released) == sorted(names)
    assert sorted(resumed) == sorted(names)
    queued = [n for n in ['m0.py', 'm1.py', 'm2.py'] if n in finished]
    assert queued == ['m0.py', 'm1.py', 'm2.py']
    assert remote['remote']['parked_scans'] == 0 and remote['failed'] == []
    assert remote['files'] == local['files']
    assert (remoteproject.DatabaseContents(str(tmp_path / 'remote.sqlite'))
            == remoteproject.DatabaseContents(str(tmp_path / 'local.sqlite')))


def test_failed_inspection_leaves_the_work_parked_and_reported(tmp_path, fresh_loop):
    root = make_tree(tmp_path / 'proj')
    os.chmod(root / 'm1.py', 0)
    summary = run_job(root, tmp_path / 'remote.sqlite', '--remote-latency', '0.02')
    assert [(f['path'], f['kind']) for f in summary['failed']] == [('m1.py', 'inspect-failed')]
    assert summary['remote']['inspect_failed'] == 1
    assert summary['remote']['parked_scans'] == 1
    assert summary['files']['scanned'] == 4 and summary['files']['not_reached'] == 0


def test_completed_scan_of_a_remote_file_with_parked_work_is_not_run_again(
        tmp_path, fresh_loop):
    (tmp_path / 'x.py').write_text('def f():\n    return 1\n')
    remote = remoteproject.CRemoteProject(str(tmp_path), 0.02)
    app = hostapp.CreateApplication(str(tmp_path), python_path=remote.PythonPath(False))
    try:
        remote.Adopt(app.fAnaMgr)
        coord = hostapp.CreateScanCoordinator(app)
        ana_mgr = app.fAnaMgr
        x = remote.Location(str(tmp_path / 'x.py'))
        coord.AddPairsToPrimaryQueue([(x, '*')], False)
        assert x in coord._fScanQueue._fWaitingForInspectByLoc
        # The data cache drops its request: x gets inspected, its parked work is
        # not released (nothing reports it ready).
        ana_mgr.fLocationDataCache.Clear()
        assert scanloop.RunUntilDone([remote.Busy], max_iterations=10_000)
        assert x.IsReady() and x in coord._fScanQueue._fWaitingForInspectByLoc
        coord.AddPairsToSecondaryQueue([(x, '*')], False, 1)
        # The derived scan runs once and leaves the queue; the parked scan stays.
        assert ostrelgtk.run_until_idle(200)
        triple = (x, '*', ana_mgr.fDerivedScanName)
        assert coord._fScanTripleCompletedCount[triple] == 1
        assert not coord.LocationInScanQueues(x)
        assert coord._fScanQueue.GetWaitingCount() == 1
    finally:
        coord.destroy()
        app.Shutdown()
        remote.Close()


# -- the helper process --------------------------------------------------------------------


class _FaultyConn:
    """The worker's end of the pipe, misbehaving after its first result."""

    def __init__(self, conn, fault):
        self.fConn, self.fFault, self.fSent = conn, fault, 0

    def recv(self):
        return self.fConn.recv()

    def send(self, message):
        self.fSent += 1
        if self.fSent == 3:  # after 'ready' and one result
            if self.fFault == 'garbage':
                message = ('done', message[1], 'not a time', None, None)
            elif self.fFault == 'hang':
                time.sleep(600)
            elif self.fFault == 'exit':
                os._exit(3)
        self.fConn.send(message)


def faulty_worker(conn, config, fault):
    helperproc._WorkerMain(_FaultyConn(conn, fault), config)


@pytest.mark.parametrize('fault, reason', [
    ('kill', 'exited'), ('exit', 'exited'), ('garbage', 'not a result'),
    ('hang', 'no answer for 2 s')])
def test_helper_gone_mid_scan_loses_nothing(tmp_path, fresh_loop, monkeypatch, fault, reason):
    # The worker gets m0, m1, ... first; m1 is long, so it is being scanned when the
    # worker is killed after m0.
    root = make_tree(tmp_path / 'proj', n=8, big=1)
    local = run_job(root, tmp_path / 'local.sqlite')
    start = helperproc.CHelperProcessSupport.Start

    def start_faulty(self):
        self.fDeadline = 2.0
        if fault != 'kill':
            self._fWorker, self._fWorkerArgs = faulty_worker, (fault,)
        start(self)

    store = helperproc.CHelperProcessSupport._Store

    def store_then_kill(self, loc, *args):
        store(self, loc, *args)
        if fault == 'kill' and len(self.fScanned) == 1:
            os.kill(self.fProcess.pid, signal.SIGKILL)

    monkeypatch.setattr(helperproc.CHelperProcessSupport, 'Start', start_faulty)
    monkeypatch.setattr(helperproc.CHelperProcessSupport, '_Store', store_then_kill)
    summary = run_job(root, tmp_path / 'helper.sqlite', '--helper')
    helper = summary['helper']
    assert helper['files_scanned'] >= 1 and reason in helper['gone']
    assert helper['taken_back'] >= 1
    assert summary['files'] == local['files']
    assert (remoteproject.DatabaseContents(str(tmp_path / 'helper.sqlite'))
            == remoteproject.DatabaseContents(str(tmp_path / 'local.sqlite')))


def test_helper_scans_and_flush_reaches_it(tmp_path, fresh_loop):
    root = make_tree(tmp_path / 'proj', n=6)
    app = hostapp.CreateApplication(str(root), python_path=[str(root)])
    coord = hostapp.CreateScanCoordinator(app)
    helper = helperproc.CHelperProcessSupport(app.fAnaMgr, str(root), max_backlog=100)
    try:
        helper.Start()
        coord._UpdateForHelperProcess()
        files = app.ProjectFiles()
        added, removed = [], []
        cb = helper.fHelperCallbackObj
        cb.connect('scan-queue-locs-added', lambda _o, locs: added.extend(locs))
        cb.connect('scan-queue-locs-removed', lambda _o, locs: removed.extend(locs))
        coord.AddParseablesToQueue(files)
        assert set(coord._fLocsQueuedInHelper) == set(files) and coord._fScanQueue.Empty()
        coord.FlushQueue()
        assert not helper.Busy() and not coord._fLocsQueuedInHelper
        # The worker dropped what it had; what it is sent now comes back.
        m0 = app.fProjectDir.Join('m0.py')
        coord.AddPairsToPrimaryQueue([(m0, '*')], False)
        assert scanloop.RunUntilDone([helper.Busy], max_iterations=100_000)
        # Flushed files are neither announced nor taken in; m0's imports follow it.
        assert helper.fGoneReason is None and added[0] == m0 and m0 in removed
        assert m0 in helper.fScanned and set(helper.fScanned) <= set(added)
        flushed = {app.fProjectDir.Join(f'm{i}.py') for i in range(1, 6)}
        assert not flushed & set(helper.fScanned)
        assert 'C0' in app.fAnaMgr.fInfoCache.GetScopeInfos(m0)
        assert coord.QueuesEmpty(True)
    finally:
        helper.destroy()
        coord.destroy()
        app.Shutdown()
