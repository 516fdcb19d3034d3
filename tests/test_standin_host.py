"""The stand-in host's analysis services: scanners, information cache, locations, managers."""
import os
import time

import hostapp
import pytest
import singleton
from cache import textcache
from guiutils import ostrelgtk
from ostrelbase import containers, location, mime, remoteclient
from pysource.scopescanner import kFinishedScanning, kScanAbandoned, kTimedOut, kWaitingForData

from pysource import analysismgr, scopeinfo, scopescanner

SAMPLE = '''\
import os.path
import json as js
from pkg import helper as h
from . import sibling
from pkg.sub import *

LIMIT = 10
NAME = h.make("a;b")


class Shape(Base):
    sides = [1, 2]

    def __init__(self, w, h=3):
        self.w = w
        self.label = "x"

    @staticmethod
    def build(x):
        x.ignored = 1

    def area(self):
        def inner():
            return 1
        return inner


def f():
    pass


def f():
    return 2
'''


@pytest.fixture
def project(tmp_path):
    location.ResetForTests()
    (tmp_path / 'pkg').mkdir()
    (tmp_path / 'pkg' / '__init__.py').write_text('')
    (tmp_path / 'pkg' / 'helper.py').write_text('def make(s):\n    return s\n')
    (tmp_path / 'pkg' / 'sub.py').write_text('VALUE = 1\n')
    (tmp_path / 'mod.py').write_text(SAMPLE)
    app = hostapp.CreateApplication(str(tmp_path), db_path=str(tmp_path / 'info.sqlite'),
                                    python_path=[str(tmp_path)])
    yield app
    app.Shutdown()
    remoteclient.UnregisterAll()
    location.ResetForTests()


def loc_of(app, *parts):
    return app.fProjectDir.Join(*parts)


def scan_to_end(scanner, budget=0.0, limit=1000):
    """Run slices (deadline ``budget`` seconds away) until the scan ends."""
    states = []
    for _ in range(limit):
        states.append(scanner.Scan(time.time() + budget))
        if states[-1] in (kFinishedScanning, kScanAbandoned, kWaitingForData):
            return states
    raise AssertionError('scan did not end')


def whole_file_scan(app, loc, incomplete=None):
    scanner = scopescanner.CWholeFilePrimaryScanner(
        loc, app.fAnaMgr.fPrimaryScanName,
        incomplete_scope_set=incomplete if incomplete is not None else set())
    try:
        states = scan_to_end(scanner, budget=10)
    finally:
        scanner.destroy()
    return states


def test_whole_file_scans(project):
    loc = loc_of(project, 'mod.py')
    cache = project.fAnaMgr.fInfoCache
    assert whole_file_scan(project, loc) == [kFinishedScanning]
    infos = cache.GetScopeInfos(loc)
    assert sorted(infos) == ['', 'Shape', 'Shape.__init__', 'Shape.area', 'Shape.area.inner',
                             'Shape.build', 'f', 'f#2']
    top = infos[''].type_equivs
    assert {k: top[k] for k in ('os', 'js', 'h', 'sibling', '*', 'LIMIT', 'NAME', 'f')} == {
        'os': b':ios.path', 'js': b':ijson', 'h': b':fpkg helper', 'sibling': b':f. sibling',
        '*': b':fpkg.sub *', 'LIMIT': b':lint', 'NAME': b'h.make("a;b")',
        'f': b':df|28|29|;:df#2|32|33|'}
    assert infos['Shape.__init__'].type_equivs == {
        'self': b':a0', 'w': b':a1', 'h': b':a2=3', 'self.w': b'w', 'self.label': b':lstr'}
    assert 'x.ignored' not in infos['Shape.build'].type_equivs  # not the instance
    assert sorted(eq for _loc, _scope, eq in cache.GetAllImports([loc])) == [
        b':f. sibling', b':fpkg helper', b':fpkg.sub *', b':ijson', b':ios.path']
    mtime = loc.GetMTime()
    assert cache.GetScansDoneForMultipleFiles({loc: mtime}) == {loc: 'scope-primary'}
    assert cache.GetScansDoneForMultipleFiles({loc: mtime + 1}) == {loc: ''}
    assert (cache.GetDiskMTime(loc), cache.GetDiskMTime(loc_of(project, 'gone.py'))) == (mtime, 0)
    # Slices make progress and give the same result.
    scanner = scopescanner.CWholeFilePrimaryScanner(loc, project.fAnaMgr.fPrimaryScanName)
    states = scan_to_end(scanner, budget=-1)  # every slice starts out of time
    scanner.destroy()
    assert states == [kTimedOut] * 7 + [kFinishedScanning]
    assert all(infos[name].SameContent(cache.GetScopeInfos(loc)[name]) for name in infos)


def test_syntax_errors_mark_scopes_incomplete(project):
    with open(os.path.join(project.fProjectDir.fPath, 'broken.py'), 'w') as f:
        f.write('X = 1\n\ndef good():\n    return 1\n\ndef bad():\n    y = (1,\n'
                '    return y\n\nclass C:\n    def m(self):\n        pass\n')
    loc = loc_of(project, 'broken.py')
    incomplete = {'stale-name'}
    whole_file_scan(project, loc, incomplete)
    assert incomplete == {'bad'}
    infos = project.fAnaMgr.fInfoCache.GetScopeInfos(loc)
    assert {'', 'good', 'bad', 'C', 'C.m'} <= set(infos)
    assert infos['bad'].incomplete and not infos['good'].incomplete


def test_single_scope_scans(project):
    loc = loc_of(project, 'mod.py')
    needs = []
    project.fAnaMgr.fInfoCache.connect('needs-scan-added', lambda c, t, prio: needs.append(t))

    def scan(scope, notify=False):
        scanner = scopescanner.CSingleScopePrimaryScanner(loc, scope)
        assert scanner.Scan(time.time() + 5) == kFinishedScanning
        result = (scanner.fInfo, scanner.fScopeDef, scanner.fContainingClassDef,
                  scanner.SaveToInfoCache(notify))
        scanner.destroy()
        return result

    _info, scope_def, containing, changed = scan('Shape.area')
    assert changed and scope_def.fType == 'def' and containing.fScopeName == 'Shape'
    assert scan('Shape.area')[3] is False  # nothing changed the second time
    info, scope_def, _containing, _changed = scan('Nope')
    assert info.does_not_exist and scope_def is None and needs == []
    scan('f#2', notify=True)
    assert needs == [[(loc, 'f#2', 'scope-derived')]]


def test_derived_information_dependents_and_the_database(project, tmp_path):
    mod, helper = loc_of(project, 'mod.py'), loc_of(project, 'pkg', 'helper.py')
    whole_file_scan(project, helper)
    whole_file_scan(project, mod)
    cache = project.fAnaMgr.fInfoCache
    scanner = scopescanner.CWholeFileSecondaryScanner(mod, 'scope-derived')
    assert scan_to_end(scanner, budget=5)[-1] == kFinishedScanning
    scanner.destroy()
    derived = cache.GetDerivedInfo(mod, '')
    assert {k: derived[k] for k in ('h', 'LIMIT', 'Shape')} == {
        'h': f'module {helper.fUrl}', 'LIMIT': 'instance int', 'Shape': f'class {mod.fUrl}#Shape'}
    assert cache.GetScansDoneForMultipleFiles({mod: mod.GetMTime()})[mod] == \
        'scope-primary scope-derived'
    assert cache.WriteToDatabase() == 2 and cache.WriteToDatabase() == 0
    fresh = scopeinfo.CInfoCache('scope-primary', 'scope-derived', str(tmp_path / 'info.sqlite'))
    assert fresh.LoadFromDatabase() == 2
    old, new = cache.GetScopeInfos(mod), fresh.GetScopeInfos(mod)
    assert sorted(old) == sorted(new) and all(old[n].SameContent(new[n]) for n in old)
    assert fresh.GetDerivedInfo(mod, '') == derived
    fresh.destroy()
    # Rescanning a changed helper reports the importer's derived scan as stale.
    needs = []
    cache.connect('needs-scan-added', lambda c, triples, prio: needs.extend(triples))
    with open(os.path.join(project.fProjectDir.fPath, 'pkg', 'helper.py'), 'a') as f:
        f.write('OTHER = 2\n')
    whole_file_scan(project, helper)
    assert needs == [(mod, '*', 'scope-derived')]


def test_locations_and_inspection(project, tmp_path):
    a = location.CreateFromName(str(tmp_path / 'x.py'))
    b = location.CreateFromName('file://' + str(tmp_path / 'sub' / '..' / 'x.py'))
    assert a == b and hash(a) == hash(b) and a.GetParentDir() == project.fProjectDir
    remote = location.CreateFromName('remote://host/a/b.py')
    assert remote.GetParentDir().GetParentDir().GetParentDir().fUrl == 'remote://host/'
    assert a.IsReady() and not remote.IsReady() and location.IsAsyncInspectLocation(remote)
    assert not any(location.IsAsyncInspectLocation(o) for o in (None, 'remote://h/x', a))
    remoteclient.RegisterServer('box', str(tmp_path), latency_ms=0)
    locs = [location.CreateFromName('remote://box/mod.py'),
            location.CreateFromName('remote://box/none.py')]
    calls = []
    location._WaitForInspectMultiple(locs, calls.append, False)
    assert calls == [] and not locs[0].IsReady()
    assert ostrelgtk.run_until_idle() and calls == [False]
    assert locs[0].Exists() and locs[1].IsReady() and not locs[1].Exists()
    assert locs[0].ReadBytes() == SAMPLE.encode()
    location._WaitForInspectMultiple(locs + [a], calls.append, False)  # inspected already
    assert calls == [False, False]
    # The location data cache asks for inspections and announces the results.
    ldc = project.fAnaMgr.fLocationDataCache
    ready, failed = [], []
    ldc.connect('now-tree-branch-ready', lambda c, s: ready.append(s))
    ldc.connect('inspect-failed', lambda c, s: failed.append(s))
    loc, bad = (location.CreateFromName(n) for n in ('remote://box/pkg/helper.py',
                                                     'remote://gone/x.py'))
    assert ldc.TreeBranchReady(a, True)
    assert not ldc.TreeBranchReady(loc, False) and not ldc.TreeBranchReady(loc, True)
    assert not ldc.TreeBranchReady(bad, True)
    ostrelgtk.run_until_idle()
    assert ready == [{loc}] and failed == [{bad}] and ldc.TreeBranchReady(loc, True)


def test_a_remote_scan_waits_for_data_and_inspection_can_abort(project, tmp_path):
    remoteclient.RegisterServer('box', str(tmp_path))
    loc = location.CreateFromName('remote://box/pkg/helper.py')
    scanner = scopescanner.CWholeFilePrimaryScanner(loc, 'scope-primary')
    changes = []
    scanner.connect('scan-state-changed', changes.append)
    assert scanner.Scan(time.time() + 5) == scanner.Scan(time.time() + 5) == kWaitingForData
    ostrelgtk.run_until_idle()
    assert changes == [scanner] and scanner.Scan(time.time() + 5) == kFinishedScanning
    scanner.destroy()
    assert 'make' in project.fAnaMgr.fInfoCache.GetScopeInfo(loc, '').type_equivs
    ostrelgtk.set_clock(ostrelgtk.CFakeClock())
    server = containers.RegisterContainer('ctr', str(tmp_path), latency_ms=500)
    stopped, calls = [], []
    containers.CContainerInspectorManager.class_connect_while_alive(
        'server-stopped', ostrelgtk.NoArgCallback(lambda: stopped.append(1)), project.fAnaMgr)
    location._WaitForInspectMultiple([location.CreateFromName('remote://ctr/mod.py')],
                                     calls.append, False)
    server.Stop()
    location._WaitForInspectMultiple([location.CreateFromName('remote://nohost/x')],
                                     calls.append, False)
    ostrelgtk.run_until_idle()
    assert calls == [True, True] and stopped == [1]


def test_mime_types_and_buffers(project, tmp_path):
    (tmp_path / 'script').write_text('#!/usr/bin/env python3\nprint(1)\n')
    d = dict.fromkeys(loc_of(project, n) for n in ['mod.py', 'notes.txt', 'script', 'x.PY'])
    sing = singleton.GetSingletons()
    sing.fFileAttribMgr.GetMultipleProbableMimeTypes(d)
    assert [v in mime.kAnalyzableMimeTypes for v in d.values()] == [True, False, True, True]
    loc, cache_mgr = loc_of(project, 'mod.py'), sing.fCacheMgr
    seen = []
    textcache.CTextCache.class_connect_while_alive(
        'text-modified', lambda buf, *rest: seen.append(buf.fLocation), project.fAnaMgr)
    buf = cache_mgr.OpenBuffer(loc)
    assert cache_mgr.DoesCacheBufferExist(loc, True) is buf and not buf.IsModified()
    buf.SetText('x = 1\r\n')
    assert seen == [loc] and buf.IsModified()
    assert cache_mgr.GetSourceForScan(loc) == ('x = 1\n', None)
    whole_file_scan(project, loc)  # the buffer is scanned instead of the file
    assert sorted(project.fAnaMgr.fInfoCache.GetScopeInfos(loc)) == ['']
    buf.Save()
    assert not buf.IsModified() and buf._GetLastKnownModTime() == loc.GetMTime()
    cache_mgr.CloseBuffer(loc)
    assert cache_mgr.DoesCacheBufferExist(loc, True) is None


def test_the_analysis_factory_and_the_application(project):
    factory = project.fAnaMgr.fAnalysisFactory
    pkg_dir = loc_of(project, 'pkg')
    assert factory._FindPrimaryLocsForNames({'pkg.helper', 'pkg', 'nothere', '.sub'}, pkg_dir,
                                            False) == [
        loc_of(project, 'pkg', 'sub.py'), None, loc_of(project, 'pkg', '__init__.py'),
        loc_of(project, 'pkg', 'helper.py')]
    builtin = factory.FindBuiltinMod()
    assert builtin.fLocalName == 'builtins' and builtin.fLocation.Exists()
    assert factory.GetAllLocsForName('builtins', None, False) == [builtin.fLocation]
    assert factory.GetTypingLocations() == []  # the stdlib is not on this path
    with open(loc_of(project, 'mod.pyi').fPath, 'w'):
        pass
    assert factory.GetSecondaryLocations(loc_of(project, 'mod.py')) == [
        loc_of(project, 'mod.pyi')]
    events = []
    for sig in ('suspend', 'unsuspend'):
        factory._fModFileCache.connect(sig, lambda *a, s=sig: events.append(s))
    factory.connect('import-resolution-changed', lambda *a: events.append('changed'))
    stdlib = location.CLocalFileLocation(analysismgr.StdlibDir())
    factory.SetPythonPath([project.fProjectDir, stdlib])
    assert events == ['suspend', 'unsuspend', 'changed']
    assert factory.GetTypingLocations()[0].GetBaseName() == 'typing.py'
    am = singleton.GetSingletons().fAnalysisMgr
    assert am is project.fAnaMgr and am.fHelperProcessProxy is None
    # Neither scan name contains the other (the coordinator tests substrings).
    assert am.fPrimaryScanName not in am.fDerivedScanName
    assert am.fDerivedScanName not in am.fPrimaryScanName
    assert am.fInfoCache.fLocCache.WantDerivedInfo(loc_of(project, 'mod.py'))
    assert not am.fInfoCache.fLocCache.WantDerivedInfo(stdlib.Join('os.py'))
