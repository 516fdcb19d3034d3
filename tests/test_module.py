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

MODULE_NAMES = ['bisect', 'collections', 'itertools', 'sys', 'time', 'textcache', 'ostrelgtk',
                'logicalline', 'destroyable', 'location', 'mime', 'callutils', 'reflect', 'config',
                'singleton', 'analysis', 'inferenceengine', 'inferencer', 'prefs', 'scopescanner',
                'scopeinfo', 'symbolinfo', 'usageordereddict', 'utils', '_fastaccess', 'strutils']


def test_collaborator_modules_are_bound_in_body_order():
    import singleton

    from pysource import _fastaccess
    assert all(isinstance(getattr(sc, name), types.ModuleType) for name in MODULE_NAMES)
    assert sc.singleton is singleton and sc._fastaccess is _fastaccess
    names = list(vars(sc))
    order = [*MODULE_NAMES, 'CScanItem', 'kTypingModulePriority', '_CSingleScanQueue',
             '_CScanQueue', 'CSingleQueueStatus', 'CScanStatus', 'CScanCoordinator']
    assert [names.index(n) for n in order] == sorted(names.index(n) for n in order)


def test_constants_records_and_classes():
    priorities = (sc.kTypingModulePriority, sc.kInteractivePriority, sc.kBackgroundPriority)
    assert priorities == (0, 1, 2) and all(type(p) is int for p in priorities)
    assert not hasattr(sc, 'kMaxWholeFilesPerCheck') and not hasattr(sc, 'kMinRescanInterval')
    for rec, fields in [(sc.CScanItem, ('loc', 'scope_name', 'scan_name', 'priority')),
                        (sc.CSingleQueueStatus, ('scan_name', 'priority', 'file_count')),
                        (sc.CScanStatus, ('queue_status_list', 'waiting_count'))]:
        assert rec._fields == fields and issubclass(rec, tuple)
        assert rec.__module__ == 'pysource.scancoordinator'
    from ostrelbase.destroyable import CDestroyable
    for cls in (sc._CSingleScanQueue, sc._CScanQueue, sc.CScanCoordinator):
        assert issubclass(cls, CDestroyable) and cls.__module__ == 'pysource.scancoordinator'
        assert cls.__flags__ & (1 << 9) and cls.__flags__ & (1 << 10), 'subclassable heap type'
        assert cls.__weakrefoffset__ != 0
    assert sc.CScanCoordinator.__doc__ == 'Class to coordinate scanning of files'


def test_time_helpers():
    before = time.time()
    assert before - 0.01 <= sc.GetNowTime() <= time.time() + 0.01
    assert sc.OutOfTime(sc.GetNowTime() - 1.0) is True
    assert sc.OutOfTime(sc.GetNowTime() + 60.0) is False
    with pytest.raises(TypeError):
        sc.OutOfTime('soon')


class TestInitialisation:
    def test_importing_again_returns_the_same_module(self):
        mod = sys.modules.pop('pysource.scancoordinator')
        try:
            assert importlib.import_module('pysource.scancoordinator') is mod
        finally:
            sys.modules['pysource.scancoordinator'] = mod
        spec = importlib.util.find_spec('pysource.scancoordinator')
        assert spec.loader.create_module(spec) is sc

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

    def test_without_a_package_the_engines_modules_are_bound(self):
        code = 'import sys; sys.path.insert(0, sys.argv[1]); import scancoordinator as m; ' \
               'print(m.analysis.__name__)'
        env = dict(os.environ, PYTHONPATH=os.pathsep.join(p for p in sys.path if p))
        out = subprocess.run([sys.executable, '-c', code, os.path.dirname(sc.__file__)],
                             capture_output=True, text=True, timeout=120, env=env, check=False)
        assert out.stdout == 'pysource.analysis\n', out.stderr

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
