"""The stand-in host's analysis services: scanners, information cache, locations, managers."""
import io
import os
import textwrap
import time

import hostapp
import pytest
import singleton
from cache import textcache
from edit import editor
from guiutils import ostrelgtk
from ostrelbase import containers, location, mime, remoteclient
from pysource.scopescanner import kFinishedScanning, kScanAbandoned, kTimedOut, kWaitingForData

from pysource import _fastaccess, analysis, analysismgr, scopeinfo, scopescanner, symbolinfo

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
    ostrelgtk.reset()
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
    ostrelgtk.reset()


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


class TestPrimaryScans:
    def test_whole_file_scan_records_every_scope(self, project):
        loc = loc_of(project, 'mod.py')
        assert whole_file_scan(project, loc) == [kFinishedScanning]
        infos = project.fAnaMgr.fInfoCache.GetScopeInfos(loc)
        assert sorted(infos) == ['', 'Shape', 'Shape.__init__', 'Shape.area',
                                 'Shape.area.inner', 'Shape.build', 'f', 'f#2']
        top = infos[''].type_equivs
        assert top['os'] == b':ios.path'
        assert top['js'] == b':ijson'
        assert top['h'] == b':fpkg helper'
        assert top['sibling'] == b':f. sibling'
        assert top['*'] == b':fpkg.sub *'
        assert top['LIMIT'] == b':lint'
        assert top['NAME'] == b'h.make("a;b")'
        assert top['f'] == b':df|28|29|;:df#2|32|33|'
        shape = infos['Shape']
        assert shape.GetDefInfo() == symbolinfo.CDefInfo(symbolinfo.kClassPrefix, 'Shape',
                                                         11, 25, ())
        assert shape.type_equivs['sides'] == b':llist'
        init = symbolinfo.UnpackDefInfoStr(shape.type_equivs['__init__'])
        assert (init.prefix, init.scope_name, init.args) == (
            symbolinfo.kUnboundMethodPrefix, 'Shape.__init__', ('self', 'w', 'h'))
        assert infos['Shape.__init__'].type_equivs == {
            'self': b':a0', 'w': b':a1', 'h': b':a2=3', 'self.w': b'w', 'self.label': b':lstr'}
        # A static method's first parameter is not the instance.
        assert 'x.ignored' not in infos['Shape.build'].type_equivs
        assert infos['Shape.area'].type_equivs['inner'].startswith(b':dShape.area.inner|')

    def test_imports_and_scans_done(self, project):
        loc = loc_of(project, 'mod.py')
        cache = project.fAnaMgr.fInfoCache
        whole_file_scan(project, loc)
        imports = sorted(eq for _loc, _scope, eq in cache.GetAllImports([loc]))
        assert imports == [b':f. sibling', b':fpkg helper', b':fpkg.sub *', b':ijson',
                           b':ios.path']
        mtime = loc.GetMTime()
        assert cache.GetScansDoneForMultipleFiles({loc: mtime}) == {loc: 'scope-primary'}
        assert cache.GetScansDoneForMultipleFiles({loc: mtime + 1}) == {loc: ''}
        assert cache.GetDiskMTime(loc) == mtime
        assert cache.GetDiskMTime(loc_of(project, 'gone.py')) == 0.0

    def test_slices_make_progress_and_give_the_same_result(self, project):
        loc = loc_of(project, 'mod.py')
        scanner = scopescanner.CWholeFilePrimaryScanner(loc, project.fAnaMgr.fPrimaryScanName)
        states = scan_to_end(scanner, budget=-1)  # every slice starts out of time
        scanner.destroy()
        assert states[:-1] == [kTimedOut] * (len(states) - 1)
        assert states[-1] == kFinishedScanning and len(states) == 8
        sliced = project.fAnaMgr.fInfoCache.GetScopeInfos(loc)
        whole_file_scan(project, loc)
        at_once = project.fAnaMgr.fInfoCache.GetScopeInfos(loc)
        assert all(sliced[name].SameContent(at_once[name]) for name in at_once)

    def test_syntax_errors_mark_scopes_incomplete(self, project):
        path = project.fProjectDir.fPath
        with open(os.path.join(path, 'broken.py'), 'w') as f:
            f.write('X = 1\n\ndef good():\n    return 1\n\ndef bad():\n    y = (1,\n'
                    '    return y\n\nclass C:\n    def m(self):\n        pass\n')
        loc = loc_of(project, 'broken.py')
        incomplete = {'stale-name'}
        whole_file_scan(project, loc, incomplete)
        assert incomplete == {'bad'}
        infos = project.fAnaMgr.fInfoCache.GetScopeInfos(loc)
        assert {'', 'good', 'bad', 'C', 'C.m'} <= set(infos)
        assert infos['bad'].incomplete and not infos['good'].incomplete

    def test_single_scope_scan(self, project):
        loc = loc_of(project, 'mod.py')
        cache = project.fAnaMgr.fInfoCache
        needs = []
        cache.connect('needs-scan-added', lambda c, triples, prio: needs.append(triples))

        def scan(scope, notify=False):
            scanner = scopescanner.CSingleScopePrimaryScanner(loc, scope)
            assert scanner.Scan(time.time() + 5) == kFinishedScanning
            changed = scanner.SaveToInfoCache(notify)
            result = (scanner.fInfo, scanner.fScopeDef, scanner.fContainingClassDef, changed)
            scanner.destroy()
            return result

        info, scope_def, containing, changed = scan('Shape.area')
        assert changed and scope_def.fType == 'def' and containing.fScopeName == 'Shape'
        assert containing.fType == scopescanner.logicalline.kClassDef
        assert scan('Shape.area')[3] is False  # nothing changed the second time
        info, scope_def, containing, changed = scan('Shape')
        assert scope_def.fType == scopescanner.logicalline.kClassDef and containing is None
        info, scope_def, _containing, changed = scan('Nope')
        assert info.does_not_exist and scope_def is None
        assert needs == []
        scan('f#2', notify=True)
        assert needs == [[(loc, 'f#2', 'scope-derived')]]

    def test_missing_file(self, project):
        loc = loc_of(project, 'missing.py')
        scanner = scopescanner.CSingleScopePrimaryScanner(loc, 'x')
        assert scanner.Scan(time.time() + 1) == kScanAbandoned
        assert scanner.fFileDoesntExist and scanner.SaveToInfoCache() is False
        scanner.destroy()

    def test_open_buffer_is_scanned_instead_of_the_file(self, project):
        loc = loc_of(project, 'mod.py')
        buf = singleton.GetSingletons().fCacheMgr.OpenBuffer(loc)
        buf.SetText('def edited():\n    pass\n')
        whole_file_scan(project, loc)
        cache = project.fAnaMgr.fInfoCache
        assert sorted(cache.GetScopeInfos(loc)) == ['', 'edited']
        # An unsaved buffer records no scan as done for any file time.
        assert cache.GetScansDoneForMultipleFiles({loc: loc.GetMTime()}) == {loc: ''}

    def test_instance_scope(self, project):
        loc = loc_of(project, 'mod.py')
        whole_file_scan(project, loc)
        cache = project.fAnaMgr.fInfoCache
        methods = [cache.GetScopeInfo(loc, s) for s in ('Shape.__init__', 'Shape.build')]
        inst = scopescanner.CreateClassInstInfo(cache.GetScopeInfo(loc, 'Shape'), methods,
                                                'scope-primary')
        assert inst.key == scopeinfo.CScopeInfoKey(loc, 'Shape()', 'scope-primary', loc,
                                                   'Shape')
        assert inst.type_equivs['__init__'].startswith(symbolinfo.kMethodPrefix)
        assert inst.type_equivs['w'] == b'w' and inst.type_equivs['label'] == b':lstr'
        engine = project.fAnaMgr.fInferenceEngine
        ctx = engine.NewContext(time.time() + 5)
        built = engine.GetScopeInfo(loc, 'Shape()', ctx)
        assert set(built.type_equivs) == set(inst.type_equivs)
        assert engine.NewContext(time.time() - 1).OutOfTime()


class TestSecondaryScans:
    def test_derived_information_and_dependents(self, project):
        mod, helper = loc_of(project, 'mod.py'), loc_of(project, 'pkg', 'helper.py')
        whole_file_scan(project, helper)
        whole_file_scan(project, mod)
        cache = project.fAnaMgr.fInfoCache
        scanner = scopescanner.CWholeFileSecondaryScanner(mod, 'scope-derived')
        assert scanner.FilterNeedsScan([(mod, 'f', 'scope-derived'),
                                        (helper, 'f', 'scope-derived'),
                                        (mod, 'f', 'scope-primary')]) == [
            (helper, 'f', 'scope-derived'), (mod, 'f', 'scope-primary')]
        assert scan_to_end(scanner, budget=5)[-1] == kFinishedScanning
        scanner.destroy()
        derived = cache.GetDerivedInfo(mod, '')
        assert derived['h'] == f'module {helper.fUrl}'
        assert derived['LIMIT'] == 'instance int'
        assert derived['Shape'] == f'class {mod.fUrl}#Shape'
        assert derived['*'] == f'module {loc_of(project, "pkg", "sub.py").fUrl}'
        assert cache.GetScansDoneForMultipleFiles({mod: mod.GetMTime()})[mod] == \
            'scope-primary scope-derived'
        # Rescanning a changed helper reports the importer's derived scan as stale.
        needs = []
        cache.connect('needs-scan-added', lambda c, triples, prio: needs.extend(triples))
        path = os.path.join(project.fProjectDir.fPath, 'pkg', 'helper.py')
        with open(path, 'a') as f:
            f.write('OTHER = 2\n')
        whole_file_scan(project, helper)
        assert needs == [(mod, '*', 'scope-derived')]

    def test_single_scope_secondary(self, project):
        mod = loc_of(project, 'mod.py')
        whole_file_scan(project, mod)
        info = project.fAnaMgr.fInfoCache.GetScopeInfo(mod, 'Shape.__init__')
        scanner = scopescanner.CSingleScopeSecondaryScanner(info, None, None, project.fAnaMgr)
        assert scanner.Scan(time.time() + 5) == kFinishedScanning
        scanner.destroy()
        assert project.fAnaMgr.fInfoCache.GetDerivedInfo(mod, 'Shape.__init__') == {
            'self': 'parameter', 'w': 'parameter', 'h': 'parameter',
            'self.w': 'parameter', 'self.label': 'instance str'}


class TestInfoCacheDatabase:
    def test_round_trip(self, project, tmp_path):
        mod = loc_of(project, 'mod.py')
        cache = project.fAnaMgr.fInfoCache
        whole_file_scan(project, mod)
        scanner = scopescanner.CWholeFileSecondaryScanner(mod, 'scope-derived')
        scan_to_end(scanner, budget=5)
        scanner.destroy()
        assert cache.WriteToDatabase() == 1
        assert cache.WriteToDatabase() == 0  # nothing changed since
        assert os.path.exists(tmp_path / 'info.sqlite')

        fresh = scopeinfo.CInfoCache('scope-primary', 'scope-derived',
                                     str(tmp_path / 'info.sqlite'))
        try:
            assert fresh.LoadFromDatabase() == 1
            old, new = cache.GetScopeInfos(mod), fresh.GetScopeInfos(mod)
            assert sorted(old) == sorted(new)
            assert all(old[name].SameContent(new[name]) for name in old)
            assert fresh.GetDerivedInfo(mod, '') == cache.GetDerivedInfo(mod, '')
            mtime = mod.GetMTime()
            assert fresh.GetScansDoneForMultipleFiles({mod: mtime}) == {
                mod: 'scope-primary scope-derived'}
        finally:
            fresh.destroy()

    def test_forgotten_file_is_removed_from_the_database(self, project, tmp_path):
        mod = loc_of(project, 'mod.py')
        cache = project.fAnaMgr.fInfoCache
        whole_file_scan(project, mod)
        cache.WriteToDatabase()
        cache.ForgetFile(mod)
        assert cache.WriteToDatabase() == 1
        fresh = scopeinfo.CInfoCache('p', 'd', str(tmp_path / 'info.sqlite'))
        assert fresh.LoadFromDatabase() == 0
        fresh.destroy()

    def test_no_database_configured(self):
        cache = scopeinfo.CInfoCache('p', 'd')
        assert cache.WriteToDatabase() is None and cache.LoadFromDatabase() == 0
        cache.destroy()

    def test_add_scope_info_reports_change(self, project):
        cache = project.fAnaMgr.fInfoCache
        loc = loc_of(project, 'x.py')
        key = scopeinfo.CScopeInfoKey(loc, 'C', 'scope-primary', loc, 'C')
        assert cache.AddScopeInfo(scopeinfo.CScopeInfo(key, '', 1.0, False,
                                                       does_not_exist=True))
        assert not cache.AddScopeInfo(scopeinfo.CScopeInfo(key, b'', 2.0, False, True))
        assert cache.GetScopeInfo(loc, 'C').disk_mtime == 2.0


class TestSymbolInfo:
    def test_non_nested_split(self):
        split = symbolinfo.NonNestedSplit
        assert split(b'a;f(x;y);[1;2];"q;r";\'s;\\\';t\';z', ';') == [
            b'a', b'f(x;y)', b'[1;2]', b'"q;r"', b"'s;\\';t'", b'z']
        assert split('a;b', ';') == ['a', 'b']
        assert split(b'', ';') == [] and split(b'x', ';') == [b'x']
        assert split(b')a;b', b';') == [b')a', b'b']  # stray closer does not nest

    def test_scope_names(self):
        assert symbolinfo.IsInstanceScope('A.B()') and not symbolinfo.IsInstanceScope('()')
        assert symbolinfo.GetInstanceNameForClass('A.B') == 'A.B()'
        assert symbolinfo.GetClassForInstanceName('A.B()') == 'A.B'
        with pytest.raises(ValueError):
            symbolinfo.GetClassForInstanceName('A.B')
        assert symbolinfo.ParentScopeName('A.B.c') == 'A.B'
        assert symbolinfo.ParentScopeName('A') == ''
        assert symbolinfo.ParentAndLeafScopeNames('A.f#2') == ('A', 'f#2')
        assert symbolinfo.SplitScopeNameFromSuffixes('f#2') == ('f', '#2', '')
        assert symbolinfo.SplitScopeNameFromSuffixes('A.C#3()') == ('A.C', '#3', '()')
        assert symbolinfo.SplitScopeNameFromSuffixes('x#y') == ('x#y', '', '')

    def test_equivalents(self):
        assert symbolinfo.kPrefixLen == len(symbolinfo.kImportPrefix) == 2
        assert symbolinfo.EquivKind(b':ios') == symbolinfo.kImportKind
        assert symbolinfo.EquivKind(b'foo()') == symbolinfo.kPlainEquivKind
        infos = b'x;' + symbolinfo.PackDefInfoStr(symbolinfo.kMethodPrefix, 'C.m', 3, 4,
                                                  ['self'])
        assert symbolinfo.InfoContains(infos, (symbolinfo.kUnboundMethodPrefix,
                                               symbolinfo.kMethodPrefix))
        assert not symbolinfo.InfoContains(infos, symbolinfo.kClassPrefix)
        assert symbolinfo.FindDefInfo(infos, symbolinfo.kMethodPrefix).scope_name == 'C.m'
        with pytest.raises(TypeError):
            symbolinfo.UnpackDefInfoStr(':mC.m|3|4|self')
        assert symbolinfo.JoinEquivs([b'a;b', b'b;c', b'']) == b'a;b;c'
        assert symbolinfo.AllDotsInSlice('..', 0, 2)
        assert not symbolinfo.AllDotsInSlice('..a', 0, 3)


class TestLocations:
    def test_identity(self, tmp_path):
        a = location.CreateFromName(str(tmp_path / 'x.py'))
        b = location.CreateFromName('file://' + str(tmp_path / 'sub' / '..' / 'x.py'))
        assert a == b and hash(a) == hash(b) and len({a, b}) == 1
        assert a.GetParentDir() == location.CLocalFileLocation(str(tmp_path))
        assert a != location.CreateFromName('remote://host' + str(tmp_path / 'x.py'))
        remote = location.CreateFromName('remote://host/a/b.py')
        assert isinstance(remote, location.CRemoteFileLocation)
        assert remote.GetParentDir().fUrl == 'remote://host/a'
        assert remote.GetParentDir().GetParentDir().GetParentDir().fUrl == 'remote://host/'
        assert a.IsReady() and not remote.IsReady()
        assert a != 'x.py' and a is not None

    def test_is_async_inspect_location_accepts_anything(self):
        assert location.IsAsyncInspectLocation(location.CRemoteFileLocation('h', '/x'))
        for other in (None, 'remote://h/x', 5, object(), location.CLocalFileLocation('/x')):
            assert location.IsAsyncInspectLocation(other) is False

    def test_local_inspection_is_immediate(self, tmp_path):
        calls = []
        location._WaitForInspectMultiple([location.CLocalFileLocation(str(tmp_path))],
                                         calls.append, False)
        assert calls == [False]

    def test_remote_inspection_arrives_from_the_main_loop(self, project, tmp_path):
        remoteclient.RegisterServer('box', str(tmp_path), latency_ms=0)
        locs = [location.CreateFromName('remote://box/mod.py'),
                location.CreateFromName('remote://box/none.py')]
        calls = []
        location._WaitForInspectMultiple(locs, calls.append, False)
        assert calls == [] and not locs[0].IsReady()
        assert ostrelgtk.run_until_idle()
        assert calls == [False]
        assert locs[0].IsReady() and locs[0].Exists()
        assert locs[1].IsReady() and not locs[1].Exists()
        assert locs[0].ReadBytes() == SAMPLE.encode()
        location._WaitForInspectMultiple(locs, calls.append, False)  # already inspected
        assert calls == [False, False]

    def test_remote_inspection_aborts(self, project, tmp_path):
        clock = ostrelgtk.CFakeClock()
        ostrelgtk.set_clock(clock)
        server = containers.RegisterContainer('ctr', str(tmp_path), latency_ms=500)
        stopped = []
        containers.CContainerInspectorManager.class_connect_while_alive(
            'server-stopped', ostrelgtk.NoArgCallback(lambda: stopped.append(1)),
            project.fAnaMgr)
        calls = []
        location._WaitForInspectMultiple([location.CreateFromName('remote://ctr/mod.py')],
                                         calls.append, False)
        server.Stop()
        assert calls == [True] and stopped == [1]
        location._WaitForInspectMultiple([location.CreateFromName('remote://nohost/x')],
                                         calls.append, False)
        ostrelgtk.run_until_idle()
        assert calls == [True, True]

    def test_location_data_cache_signals(self, project, tmp_path):
        remoteclient.RegisterServer('box', str(tmp_path))
        ldc = project.fAnaMgr.fLocationDataCache
        ready, failed = [], []
        ldc.connect('now-tree-branch-ready', lambda c, s: ready.append(s))
        ldc.connect('inspect-failed', lambda c, s: failed.append(s))
        loc = location.CreateFromName('remote://box/pkg/helper.py')
        assert ldc.TreeBranchReady(loc_of(project, 'mod.py'), True)
        assert not ldc.TreeBranchReady(loc, False)
        assert not ldc.TreeBranchReady(loc, True)
        ostrelgtk.run_until_idle()
        assert ready == [{loc}] and failed == []
        assert ldc.TreeBranchReady(loc, True)
        bad = location.CreateFromName('remote://gone/x.py')
        assert not ldc.TreeBranchReady(bad, True)
        ostrelgtk.run_until_idle()
        assert failed == [{bad}]

    def test_remote_scan_waits_for_data(self, project, tmp_path):
        remoteclient.RegisterServer('box', str(tmp_path))
        loc = location.CreateFromName('remote://box/pkg/helper.py')
        scanner = scopescanner.CWholeFilePrimaryScanner(loc, 'scope-primary')
        changes = []
        scanner.connect('scan-state-changed', changes.append)
        assert scanner.Scan(time.time() + 5) == kWaitingForData
        assert scanner.Scan(time.time() + 5) == kWaitingForData
        ostrelgtk.run_until_idle()
        assert changes == [scanner]
        assert scanner.Scan(time.time() + 5) == kFinishedScanning
        scanner.destroy()
        assert 'make' in project.fAnaMgr.fInfoCache.GetScopeInfo(loc, '').type_equivs


class TestManagers:
    def test_mime_types_filled_in_place(self, project, tmp_path):
        (tmp_path / 'script').write_text('#!/usr/bin/env python3\nprint(1)\n')
        (tmp_path / 'data').write_text('plain\n')
        names = ['mod.py', 'stub.pyi', 'notes.txt', 'script', 'data', 'image.png', 'x.PY']
        d = dict.fromkeys(loc_of(project, n) for n in names)
        keys = list(d)
        singleton.GetSingletons().fFileAttribMgr.GetMultipleProbableMimeTypes(d)
        assert list(d) == keys
        got = {k.GetBaseName(): v for k, v in d.items()}
        assert got == {'mod.py': mime.kPythonMimeType, 'stub.pyi': mime.kPythonMimeType,
                       'notes.txt': 'text/plain', 'script': mime.kPythonMimeType,
                       'data': None, 'image.png': 'image/png', 'x.PY': mime.kPythonMimeType}
        analyzable = [k.GetBaseName() for k, v in d.items() if v in mime.kAnalyzableMimeTypes]
        assert analyzable == ['mod.py', 'stub.pyi', 'script', 'x.PY']

    def test_buffers_and_text_modified(self, project):
        loc = loc_of(project, 'mod.py')
        cache_mgr = singleton.GetSingletons().fCacheMgr
        assert cache_mgr.DoesCacheBufferExist(loc, True) is None
        seen = []
        textcache.CTextCache.class_connect_while_alive(
            'text-modified', lambda buf, *rest: seen.append(buf.fLocation), project.fAnaMgr)
        buf = cache_mgr.OpenBuffer(loc)
        assert cache_mgr.DoesCacheBufferExist(loc, True) is buf
        assert not buf.IsModified() and buf._GetLastKnownModTime() == loc.GetMTime()
        assert cache_mgr.GetSourceForScan(loc) == (SAMPLE, loc.GetMTime())
        buf.SetText('x = 1\r\n')
        assert seen == [loc] and buf.IsModified()
        assert cache_mgr.GetSourceForScan(loc) == ('x = 1\n', None)
        buf.Save()
        assert not buf.IsModified() and buf._GetLastKnownModTime() == loc.GetMTime()
        cache_mgr.CloseBuffer(loc)
        assert cache_mgr.DoesCacheBufferExist(loc, True) is None

    def test_gui_manager_documents(self, project):
        gui = singleton.GetSingletons().fGuiMgr
        changes = []
        gui.connect('active-document-changed', lambda mgr, doc: changes.append(doc))
        a = gui.OpenDocument(loc_of(project, 'mod.py'))
        b = gui.OpenDocument(loc_of(project, 'pkg', 'helper.py'), visible=False,
                             activate=False)
        gui.AddDocument(editor.CHelpDocument('Manual', loc_of(project, 'manual.html')))
        assert isinstance(gui.GetActiveDocument(), editor.CSourceEditor)
        assert gui.GetActiveDocument().fCache.fLocation == loc_of(project, 'mod.py')
        assert gui.GetDocuments(visible_only=True, include_help=False) == [
            loc_of(project, 'mod.py')]
        assert gui.GetDocuments(visible_only=False, include_help=True) == [
            loc_of(project, 'mod.py'), loc_of(project, 'pkg', 'helper.py'),
            loc_of(project, 'manual.html')]
        gui.CloseDocument(a)
        assert changes == [a, None] and gui.GetActiveDocument() is None
        assert singleton.GetSingletons().fCacheMgr.DoesCacheBufferExist(
            loc_of(project, 'mod.py'), True) is None
        assert b.fCache.fLocation == loc_of(project, 'pkg', 'helper.py')

    def test_analysis_scopes_and_caret(self, project):
        loc = loc_of(project, 'mod.py')
        cache_mgr = singleton.GetSingletons().fCacheMgr
        ana = cache_mgr.GetAnalysis(loc, True)
        assert isinstance(ana, analysis.CPySourceAnalysis)
        assert cache_mgr.GetAnalysis(loc, False) is ana
        assert cache_mgr.GetAnalysis(loc_of(project, 'notes.txt'), True) is None
        # Before any scan the scopes come from the source itself.
        lines = {1: '', 12: 'Shape', 15: 'Shape.__init__', 23: 'Shape.area.inner',
                 25: 'Shape.area', 29: 'f', 33: 'f#2', 100: ''}
        assert {n: ana.FindScopeContainingLine(n) for n in lines} == lines
        whole_file_scan(project, loc)
        ana.UpdateFromCache()
        assert {n: ana.FindScopeContainingLine(n) for n in lines} == lines
        moves, mods = [], []
        analysis.CPySourceAnalysis.class_connect_while_alive(
            'active-edit-lineno-changed', lambda a, n: moves.append(n), project.fAnaMgr)
        analysis.CPySourceAnalysis.class_connect_while_alive(
            'modified', lambda a: mods.append(a), project.fAnaMgr)
        doc = singleton.GetSingletons().fGuiMgr.OpenDocument(loc)
        doc.SetCaretLine(15)
        doc.SetCaretLine(15)
        doc.SetCaretLine(-1)
        doc.fCache.SetText('pass\n')
        assert moves == [15, -1] and mods == [ana]

    def test_analysis_factory(self, project):
        factory = project.fAnaMgr.fAnalysisFactory
        pkg_dir = loc_of(project, 'pkg')
        found = factory._FindPrimaryLocsForNames({'pkg.helper', 'pkg', 'nothere', '.sub'},
                                                 pkg_dir, False)
        assert found == [loc_of(project, 'pkg', 'sub.py'), None,
                         loc_of(project, 'pkg', '__init__.py'),
                         loc_of(project, 'pkg', 'helper.py')]
        assert factory.FindModuleLoc('..mod', pkg_dir) == loc_of(project, 'mod.py')
        assert factory.FindModuleLoc('.', pkg_dir) == loc_of(project, 'pkg', '__init__.py')
        builtin = factory.FindBuiltinMod()
        assert builtin.fLocalName == 'builtins' and builtin.fLocation.Exists()
        assert factory.GetAllLocsForName('builtins', None, False) == [builtin.fLocation]
        assert project.fAnaMgr.fInfoCache.fLocCache.GetBuiltinLoc() == builtin.fLocation
        assert factory.GetTypingLocations() == []  # the stdlib is not on this path
        with open(loc_of(project, 'mod.pyi').fPath, 'w'):
            pass
        assert factory.GetSecondaryLocations(loc_of(project, 'mod.py')) == [
            loc_of(project, 'mod.pyi')]
        assert not factory.GetSecondaryLocations(loc_of(project, 'pkg', 'helper.py'))
        events = []
        for sig in ('suspend', 'unsuspend'):
            factory._fModFileCache.connect(sig, lambda *a, s=sig: events.append(s))
        factory.connect('import-resolution-changed', lambda *a: events.append('changed'))
        factory.SetPythonPath([project.fProjectDir,
                               location.CLocalFileLocation(analysismgr.StdlibDir())])
        assert events == ['suspend', 'unsuspend', 'changed']
        typing_locs = factory.GetTypingLocations()
        assert typing_locs and typing_locs[0].GetBaseName() == 'typing.py'

    def test_application_assembly(self, project):
        sing = singleton.GetSingletons()
        for name in singleton.kSingletonNames:
            assert getattr(sing, name) is not None, name
        am = sing.fAnalysisMgr
        assert am is project.fAnaMgr
        assert am.fPrimaryScanName != am.fDerivedScanName
        assert am.fPrimaryScanName not in am.fDerivedScanName
        assert am.fDerivedScanName not in am.fPrimaryScanName
        assert am.fHelperProcessProxy is None and am._fHelperProcessSupport is None
        assert list(am.fPyConfig.python_path_locs) == [project.fProjectDir]
        assert am.fInfoCache.fLocCache.WantDerivedInfo(loc_of(project, 'mod.py'))
        assert not am.fInfoCache.fLocCache.WantDerivedInfo(
            location.CLocalFileLocation(analysismgr.StdlibDir()).Join('os.py'))
        names = [loc.GetBaseName() for loc in project.ProjectFiles()]
        assert names == ['mod.py', '__init__.py', 'helper.py', 'sub.py']


class TestLogger:
    def test_logger_off_and_on(self):
        log = _fastaccess.CLogger('IdleAnalysis')
        assert log.fOutputFile is None
        log('dropped %r', 1)
        out = io.StringIO()
        _fastaccess.EnableLogging(out, ['IdleAnalysis'])
        try:
            assert log.fOutputFile is out
            assert _fastaccess.CLogger('Other').fOutputFile is None
            log('Skipping scan: %r', ('loc', '*', 'scan'))
            log('100% plain message')
            log('header\n')
        finally:
            _fastaccess.DisableLogging()
        lines = out.getvalue().splitlines()
        assert [line.split(' ', 1)[1] for line in lines] == [
            "[IdleAnalysis] Skipping scan: ('loc', '*', 'scan')",
            '[IdleAnalysis] 100% plain message', '[IdleAnalysis] header']
        assert log.fOutputFile is None


def test_tolerant_parse_keeps_line_numbers():
    text = textwrap.dedent('''\
        def a():
            return (
        def b():
            pass
        ''')
    tree, patched, failed = scopescanner.ParseTolerant(text)
    assert not failed and patched
    names = {n.name: n.lineno for n in tree.body if hasattr(n, 'name')}
    assert names.get('b') == 3
