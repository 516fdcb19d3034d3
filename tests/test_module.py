"""The module frame: imports, records, constants and the once-per-process rules."""

import ctypes
import importlib.util
import os
import subprocess
import sys
import textwrap
import time
import types

import pytest

import pysource.scancoordinator as sc

MODULE_NAMES = ['bisect', 'collections', 'itertools', 'sys', 'time',
                'textcache', 'ostrelgtk', 'logicalline', 'destroyable', 'location', 'mime',
                'callutils', 'reflect', 'config', 'singleton',
                'analysis', 'inferenceengine', 'inferencer', 'prefs', 'scopescanner',
                'scopeinfo', 'symbolinfo', 'usageordereddict', 'utils', '_fastaccess',
                'strutils']


def test_collaborator_modules_are_bound_under_their_names():
    import config
    import singleton
    from guiutils import ostrelgtk

    from pysource import _fastaccess, symbolinfo
    for name in MODULE_NAMES:
        assert isinstance(getattr(sc, name), types.ModuleType), name
    assert sc.ostrelgtk is ostrelgtk
    assert sc.config is config and sc.singleton is singleton
    assert sc.symbolinfo is symbolinfo and sc._fastaccess is _fastaccess


def test_names_are_bound_in_body_order():
    names = list(vars(sc))
    order = [*MODULE_NAMES, 'CScanItem', 'kTypingModulePriority', '_CSingleScanQueue',
             '_CScanQueue', 'CSingleQueueStatus', 'CScanStatus', 'CScanCoordinator']
    positions = [names.index(n) for n in order]
    assert positions == sorted(positions)


def test_priorities_are_published_ints_in_ascending_urgency():
    assert (sc.kTypingModulePriority, sc.kInteractivePriority, sc.kBackgroundPriority) == (0, 1, 2)
    assert all(type(p) is int for p in (sc.kTypingModulePriority, sc.kInteractivePriority,
                                        sc.kBackgroundPriority))


def test_internal_constants_are_not_published():
    assert not hasattr(sc, 'kMaxWholeFilesPerCheck')
    assert not hasattr(sc, 'kMinRescanInterval')


class TestRecords:
    def test_scan_item_fields_and_empty_item(self):
        assert sc.CScanItem._fields == ('loc', 'scope_name', 'scan_name', 'priority')
        loc, scope, name, prio = sc.CScanItem(None, None, None, None)
        assert (loc, scope, name, prio) == (None, None, None, None)
        item = sc.CScanItem('L', '*', 'primary', 2)
        assert item[:3] == ('L', '*', 'primary')
        assert item == ('L', '*', 'primary', 2) and hash(item) == hash(('L', '*', 'primary', 2))

    def test_status_records(self):
        assert sc.CSingleQueueStatus._fields == ('scan_name', 'priority', 'file_count')
        assert sc.CScanStatus._fields == ('queue_status_list', 'waiting_count')
        for rec in (sc.CScanItem, sc.CSingleQueueStatus, sc.CScanStatus):
            assert rec.__module__ == 'pysource.scancoordinator'
            assert issubclass(rec, tuple)

    def test_items_handed_out_by_the_queue_are_scan_items(self, tmp_path):
        from ostrelbase import destroyable

        class Cache(destroyable.CDestroyable):
            def __init__(self):
                super().__init__(('now-tree-branch-ready', 'inspect-failed', 'cleared'))

        q = sc._CScanQueue(Cache())
        q.SetScansToOrder({'s': 0})
        assert type(q.First()) is sc.CScanItem
        q.AddScanPairs([('L', 'a')], 's')
        item = q.First()
        assert type(item) is sc.CScanItem and item.priority == 2
        q.destroy()


class TestClasses:
    @pytest.mark.parametrize('name', ['_CSingleScanQueue', '_CScanQueue', 'CScanCoordinator'])
    def test_heap_types_derived_from_the_host_base(self, name):
        from ostrelbase.destroyable import CDestroyable
        cls = getattr(sc, name)
        assert issubclass(cls, CDestroyable)
        assert cls.__module__ == 'pysource.scancoordinator'
        assert cls.__flags__ & (1 << 9), 'heap type'
        assert cls.__flags__ & (1 << 10), 'subclassable'
        assert cls.__weakrefoffset__ != 0

    def test_coordinator_docstring(self):
        assert sc.CScanCoordinator.__doc__ == 'Class to coordinate scanning of files'


class TestTime:
    def test_now_time_is_wall_clock(self):
        before = time.time()
        now = sc.GetNowTime()
        after = time.time()
        assert before - 0.01 <= now <= after + 0.01

    def test_out_of_time(self):
        assert sc.OutOfTime(sc.GetNowTime() - 1.0) is True
        assert sc.OutOfTime(sc.GetNowTime() + 60.0) is False
        with pytest.raises(TypeError):
            sc.OutOfTime('soon')


class TestInitialisation:
    def test_importing_again_returns_the_same_module(self):
        mod = sys.modules.pop('pysource.scancoordinator')
        try:
            again = importlib.import_module('pysource.scancoordinator')
            assert again is mod
        finally:
            sys.modules['pysource.scancoordinator'] = mod

    def test_executing_the_body_for_another_module_object_raises(self):
        lib = ctypes.PyDLL(sc.__file__)
        lib.PyInit_scancoordinator.restype = ctypes.c_void_p
        module_def = lib.PyInit_scancoordinator()
        exec_def = ctypes.pythonapi.PyModule_ExecDef
        exec_def.argtypes = [ctypes.py_object, ctypes.c_void_p]
        exec_def.restype = ctypes.c_int
        with pytest.raises(RuntimeError) as err:
            exec_def(types.ModuleType('scancoordinator'), module_def)
        assert str(err.value) == ("Module 'scancoordinator' has already been imported. "
                                  "Re-initialisation is not supported.")
        # The loaded module is untouched.
        assert sc._CScanQueue.__name__ == '_CScanQueue'

    def test_second_interpreter_gets_import_error(self):
        code = textwrap.dedent('''
            import _xxsubinterpreters as interpreters
            import pysource.scancoordinator
            interp = interpreters.create()
            try:
                interpreters.run_string(interp, (
                    "try:\\n"
                    "    import pysource.scancoordinator\\n"
                    "except ImportError as e:\\n"
                    "    print('ImportError:', e)\\n"))
            finally:
                interpreters.destroy(interp)
        ''')
        env = dict(os.environ, PYTHONPATH=os.pathsep.join(p for p in sys.path if p))
        out = subprocess.run([sys.executable, '-c', code], capture_output=True, text=True,
                             timeout=120, env=env, check=False)
        assert out.returncode == 0, out.stderr
        assert ('ImportError: Interpreter change detected - this module can only be loaded '
                'into one interpreter per process.') in out.stdout

    def test_spec_loader_round_trip_returns_the_loaded_module(self):
        spec = importlib.util.find_spec('pysource.scancoordinator')
        created = spec.loader.create_module(spec)
        assert created is sc
