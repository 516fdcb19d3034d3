"""The main job as a product: the database, the scan command, bad input, interruption."""
import time

import hostapp
import pytest
from guiutils import ostrelgtk
from ostrelbase import location

from pysource import scopeinfo, scopescanner

SOURCE = '''\
import os.path
from . import helper
from helper import make as mk, *


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
