"""Scripted scanners and the collaborators of the coordinator's idle loop.

The coordinator creates its scanners itself, by looking the classes up on the
`pysource.scopescanner` module each time.  `ScannerKit.Install` replaces those
four classes with scripted doubles: each double is a CDestroyable declaring
"scan-state-changed" (the whole-file secondary one also derives from the
module's `CScanner`), takes exactly the arguments the coordinator must pass,
and answers its `Scan(end_time)` calls from a script of states registered for
its location or (location, scope name) pair.  A script entry is a state, an
exception instance (raised from `Scan`) or a callable `fn(scanner, end_time)`
returning the state.  When the script runs out the last entry repeats.

Every call made on a double goes into the shared `CallLog` of coord_doubles
(who: 'scanner', 'info_cache', 'loc_cache', 'factory', 'cache_mgr', 'buffer',
'analysis', 'reflect', 'wait'), so a test can check the order of calls across
collaborators.  The scanner doubles also keep their own history (`fScans`,
`fSaves`, `fDestroyCount`) with the wall-clock time of each `Scan` call.
Destruction is recorded by `_destroy_impl`, which `destroy()` runs once.

`ScanHost` is CoordHost with the information cache, analysis factory and cache
manager that the idle loop needs.  `ScanHost.Patch` also replaces the logger
class (the coordinator's `fLog` is then a `RecordingLogger`, logging on) and
`reflect.ReportCurrentException`.  `ScanCountingCoordinator` extends the
counting flavour of coord_doubles with the idle loop's overridable operations.
"""
import collections
import io
import json
import os
import subprocess
import sys
import textwrap
import time
from types import SimpleNamespace

import pytest
from coord_doubles import (
    DERIVED,
    PRIMARY,
    CoordHost,
    CountingCoordinator,
    CScanCoordinator,
    FakeAnalysis,
    FakeAnalysisFactory,
    FakeCacheMgr,
    FakeInfoCache,
    FakeLocCache,
    _Scripted,
    host_reset,
    local,
    make_coord,
)
from guiutils import ostrelgtk
from ostrelbase import destroyable, location
from ostrelutils import reflect

from pysource import _fastaccess, scopeinfo, scopescanner

__all__ = [
    'host_reset',
    'scoord',
    'scoord_cls',
    'shost',
]

kReadyToScan = scopescanner.kReadyToScan
kWaitingForData = scopescanner.kWaitingForData
kFinishedScanning = scopescanner.kFinishedScanning
kTimedOut = scopescanner.kTimedOut
kScanAbandoned = scopescanner.kScanAbandoned

# The kinds of scanner, with the class each one stands in for.
PRIMARY_WHOLE = 'primary-whole'
PRIMARY_SCOPE = 'primary-scope'
SECONDARY_WHOLE = 'secondary-whole'
SECONDARY_SCOPE = 'secondary-scope'
kScannerClassNames = {
    PRIMARY_WHOLE: 'CWholeFilePrimaryScanner',
    PRIMARY_SCOPE: 'CSingleScopePrimaryScanner',
    SECONDARY_WHOLE: 'CWholeFileSecondaryScanner',
    SECONDARY_SCOPE: 'CSingleScopeSecondaryScanner',
}

_kUnset = object()


# ---- scripted scanners -----------------------------------------------------------------

class Script:
    """What the scanners of one location or pair do.

    `states`: answers of successive `Scan` calls (see the module note).
    `info`, `scope_def`, `containing_class_def`, `file_doesnt_exist`: the
    scanner's result attributes.  `changed`: what `SaveToInfoCache` returns.
    """

    def __init__(self, states=(kFinishedScanning,), info=None, scope_def=None,
                 containing_class_def=None, file_doesnt_exist=False, changed=True):
        self.fStates = list(states)
        assert self.fStates, 'a script needs at least one state'
        self.fInfo = info
        self.fScopeDef = scope_def
        self.fContainingClassDef = containing_class_def
        self.fFileDoesntExist = file_doesnt_exist
        self.fChanged = changed


def add_incomplete(names, state=kFinishedScanning):
    """A script entry that adds scope names to the scanner's incomplete set."""
    def step(scanner, end_time):
        scanner.fKwargs['incomplete_scope_set'].update(names)
        return state
    return step


def info_with_equivs(**type_equivs):
    """A scanner result whose `type_equivs` maps the given names to their values."""
    return SimpleNamespace(type_equivs=dict(type_equivs))


def scope_def(def_type):
    return SimpleNamespace(fType=def_type)


ScanCall = collections.namedtuple('ScanCall', 'called_at end_time state returned_at')


class _ScriptedScanner:
    """The behaviour shared by the four scanner doubles."""

    kKind = None
    fKit = None  # set on the classes a ScannerKit makes

    def _Setup(self, key, args, kwargs):
        destroyable.CDestroyable.__init__(self, ('scan-state-changed',))
        self.fKey = key
        self.fArgs = args
        self.fKwargs = kwargs
        script = self.fKit.ScriptFor(self.kKind, key)
        self.fScript = script
        self.fStates = list(script.fStates)
        self.fInfo = script.fInfo
        self.fScopeDef = script.fScopeDef
        self.fContainingClassDef = script.fContainingClassDef
        self.fFileDoesntExist = script.fFileDoesntExist
        self.fScans = []
        self.fSaves = []
        self.fDestroyCount = 0
        self.fKit.fCreated.append(self)
        self.fKit.fLog.add('scanner', 'create', self.kKind, key)

    def __repr__(self):
        return f'<{self.kKind} scanner of {self.fKey!r}>'

    def Scan(self, end_time):
        called_at = time.time()
        self.fKit.fLog.add('scanner', 'Scan', self.kKind, self.fKey, end_time)
        step = self.fStates.pop(0) if len(self.fStates) > 1 else self.fStates[0]
        if isinstance(step, BaseException):
            self.fScans.append(ScanCall(called_at, end_time, step, time.time()))
            raise step
        state = step(self, end_time) if callable(step) else step
        self.fScans.append(ScanCall(called_at, end_time, state, time.time()))
        return state

    def SaveToInfoCache(self, *args, **kwargs):
        self.fSaves.append((args, kwargs))
        self.fKit.fLog.add('scanner', 'SaveToInfoCache', self.kKind, self.fKey, *args, **kwargs)
        return self.fScript.fChanged

    def FilterNeedsScan(self, triples):
        return list(triples)

    def _destroy_impl(self):
        # The hook that destroy() runs once, however destroy() is reached.
        self.fDestroyCount += 1
        self.fKit.fLog.add('scanner', 'destroy', self.kKind, self.fKey)

    def Connections(self):
        """How many handlers are connected to the scanner's signal now."""
        catchers = self._CDestroyable__fSignalCatchers or {}
        return sum(len(conns) for conns in catchers.values())


class _WholeFilePrimary(_ScriptedScanner, destroyable.CDestroyable):
    kKind = PRIMARY_WHOLE

    def __init__(self, loc, scan_name, *, incomplete_scope_set, log):
        self._Setup(loc, (loc, scan_name),
                    {'incomplete_scope_set': incomplete_scope_set, 'log': log})


class _SingleScopePrimary(_ScriptedScanner, destroyable.CDestroyable):
    kKind = PRIMARY_SCOPE

    def __init__(self, loc, scope_name, *, incomplete_scope_set, log):
        self._Setup((loc, scope_name), (loc, scope_name),
                    {'incomplete_scope_set': incomplete_scope_set, 'log': log})


class _WholeFileSecondary(_ScriptedScanner, scopescanner.CScanner):
    kKind = SECONDARY_WHOLE

    def __init__(self, loc, scan_name, log, /):
        # CScanner's own constructor is not run: nothing of it is used.
        self._Setup(loc, (loc, scan_name, log), {})


class _SingleScopeSecondary(_ScriptedScanner, destroyable.CDestroyable):
    kKind = SECONDARY_SCOPE

    def __init__(self, scope_info, log, ctx, ana_mgr, /):
        key = getattr(scope_info, 'key', None)
        pair = (key.loc, key.scope_name) if key is not None else id(scope_info)
        self._Setup(pair, (scope_info, log, ctx, ana_mgr), {})


_kBases = {PRIMARY_WHOLE: _WholeFilePrimary, PRIMARY_SCOPE: _SingleScopePrimary,
           SECONDARY_WHOLE: _WholeFileSecondary, SECONDARY_SCOPE: _SingleScopeSecondary}


class ScannerKit:
    """The four scanner doubles, their scripts and every scanner they made."""

    def __init__(self, log):
        self.fLog = log
        self.fScripts = {}
        self.fCreated = []
        self.fClasses = {kind: type(kScannerClassNames[kind], (base,), {'fKit': self})
                         for kind, base in _kBases.items()}

    def Install(self, monkeypatch):
        for kind, cls in self.fClasses.items():
            monkeypatch.setattr(scopescanner, kScannerClassNames[kind], cls)

    def Script(self, kind, key, states=(kFinishedScanning,), **attrs):
        """Scanners of `kind` made from now on for `key` (a location for the
        whole-file kinds, a (location, scope name) pair otherwise) follow this."""
        assert kind in kScannerClassNames, kind
        self.fScripts[(kind, key)] = Script(states, **attrs)

    def ScriptFor(self, kind, key):
        return self.fScripts.get((kind, key)) or Script()

    def Made(self, kind=None, key=_kUnset):
        return [s for s in self.fCreated if (kind is None or s.kKind == kind)
                and (key is _kUnset or s.fKey == key)]

    def One(self, kind, key=_kUnset):
        """The one scanner of that kind (and key) made so far."""
        made = self.Made(kind, key)
        assert len(made) == 1, made
        return made[0]


# ---- the information cache, analysis factory and cache manager --------------------

def _lookup(mapping, loc, default):
    """`mapping.get(loc, default)` without hashing `loc` (see HashSpyLocation)."""
    for key, value in mapping.items():
        if key is loc or key == loc:
            return value
    return default


class ScanLocCache(FakeLocCache):
    """Also knows the builtins module's location (`fBuiltinLoc`, None: unknown)."""

    def __init__(self, log):
        super().__init__(log)
        self.fBuiltinLoc = local('stubs/builtins.pyi')

    def GetBuiltinLoc(self):
        self._Record('GetBuiltinLoc')
        return self.fBuiltinLoc


class FakeScopeInfo:
    """Scope information as the info cache hands it out."""

    def __init__(self, loc, scope_name):
        self.key = SimpleNamespace(loc=loc, scope_name=scope_name)
        self.type_equivs = {}

    def __repr__(self):
        return f'<FakeScopeInfo {self.key.scope_name!r} of {self.key.loc!r}>'


class ScanInfoCache(FakeInfoCache, _Scripted):
    """The information cache of the idle loop, answering from plain attributes:

    `fMTimes` (loc -> disk time, else `fDefaultMTime`), `fScansDone` (loc ->
    scans-done string, else ''; `fScansDoneResult` replaces the whole answer),
    `fImports` (loc -> import equivalents), `fScopeInfos` ((loc, scope) -> info,
    None included; else one FakeScopeInfo per pair).
    """

    def __init__(self, log):
        scopeinfo.CInfoCache.__init__(self, PRIMARY, DERIVED, loc_cache=ScanLocCache(log))
        self._InitScripted(log, 'info_cache')
        self.fMTimes = {}
        self.fDefaultMTime = 100.0
        self.fScansDone = {}
        self.fScansDoneResult = _kUnset
        self.fImports = {}
        self.fScopeInfos = {}

    def GetScansDoneForMultipleFiles(self, mtime_dict):
        self._Record('GetScansDoneForMultipleFiles', dict(mtime_dict))
        if self.fScansDoneResult is not _kUnset:
            return self.fScansDoneResult
        return {loc: self.fScansDone.get(loc, '') for loc in mtime_dict}

    def GetAllImports(self, loc_list):
        loc_list = list(loc_list)
        self._Record('GetAllImports', loc_list)
        return [(loc, 'scope', eq) for loc in loc_list for eq in self.fImports.get(loc, ())]

    def GetDiskMTime(self, loc):
        self._Record('GetDiskMTime', loc)
        return _lookup(self.fMTimes, loc, self.fDefaultMTime)

    def GetScopeInfo(self, loc, scope_name):
        self._Record('GetScopeInfo', loc, scope_name)
        if (loc, scope_name) not in self.fScopeInfos:
            self.fScopeInfos[(loc, scope_name)] = FakeScopeInfo(loc, scope_name)
        return self.fScopeInfos[(loc, scope_name)]

    def FinishedWithScans(self, loc, scope_name, scan_name):
        self._Record('FinishedWithScans', loc, scope_name, scan_name)

    def Trim(self):
        self._Record('Trim')

    def WriteToDatabase(self):
        self._Record('WriteToDatabase')
        return 'ignored'


class ScanAnalysisFactory(FakeAnalysisFactory):
    """Also finds module files (`fModuleLocs`: module name -> location or None) and
    the secondary locations of a file (`fSecondaryLocs`)."""

    def __init__(self, log):
        super().__init__(log)
        self.fModuleLocs = {}
        self.fSecondaryLocs = {}

    def _FindPrimaryLocsForNames(self, names, dirloc, flag):
        names = set(names)
        self._Record('_FindPrimaryLocsForNames', names, dirloc, flag)
        return [self.fModuleLocs.get(name) for name in sorted(names, key=repr)]

    def GetSecondaryLocations(self, loc):
        self._Record('GetSecondaryLocations', loc)
        return self.fSecondaryLocs.get(loc)


class FakeBuffer(_Scripted):
    def __init__(self, log, loc, modified, mtime):
        self._InitScripted(log, 'buffer')
        self.fLocation = loc
        self.fModified = modified
        self.fMTime = mtime

    def IsModified(self):
        self._Record('IsModified', self.fLocation)
        return self.fModified

    def _GetLastKnownModTime(self):
        self._Record('_GetLastKnownModTime', self.fLocation)
        return self.fMTime


class ScanAnalysis(FakeAnalysis):
    """An analysis object that records `UpdateFromCache` once it is built."""

    def __init__(self, loc, log):
        self.fBuilt = False
        super().__init__(loc, log)
        self.fBuilt = True

    def UpdateFromCache(self):
        if self.fBuilt:
            self.fCallLog.add('analysis', 'UpdateFromCache', self.fLocation)


class ScanCacheMgr(FakeCacheMgr):
    """Open buffers with their modification state; analysis objects from `fAnalyses`."""

    def __init__(self, log):
        super().__init__(log)
        self.fAnalyses = {}

    def OpenBuffer(self, loc, modified=False, mtime=50.0):
        self.fBuffers[loc] = FakeBuffer(self.fLog, loc, modified, mtime)
        return self.fBuffers[loc]

    def GetAnalysis(self, loc, create):
        self._Record('GetAnalysis', loc, create)
        return self.fAnalyses.get(loc)


# ---- the logger ------------------------------------------------------------------

# The scan queue's listing goes through the logger too, one line per call.
_kDumpStarts = ('_CScanQueue contents:', ' ', 'Waiting for ')


class RecordingLogger(_fastaccess.CLogger):
    """Records every call as (format, values); logging is on (an in-memory file)."""

    fOutputFile = None  # a plain attribute here, not the base class's property

    def __init__(self, category):
        super().__init__(category)
        self.fCalls = []
        self.fOutputFile = io.StringIO()

    def __call__(self, msg, *values):
        self.fCalls.append((msg, values))

    def Texts(self):
        return [msg % values if values else msg for msg, values in self.fCalls]

    def Messages(self):
        """The coordinator's own messages, without the queue listing."""
        return [t for t in self.Texts() if not t.startswith(_kDumpStarts)]

    def DumpLines(self):
        return [t for t in self.Texts() if t.startswith(_kDumpStarts)]

    def Clear(self):
        del self.fCalls[:]


# ---- the host --------------------------------------------------------------------

class ScanHost(CoordHost):
    """CoordHost with the idle loop's collaborators and scanner doubles."""

    def __init__(self, python_path=True):
        super().__init__(python_path)
        self.fFactory.destroy()
        self.fInfoCache.destroy()
        self.fFactory = ScanAnalysisFactory(self.fLog)
        self.fModFileCache = self.fFactory._fModFileCache
        self.fInfoCache = ScanInfoCache(self.fLog)
        self.fLocCache = self.fInfoCache.fLocCache
        self.fAnaMgr.fInfoCache = self.fInfoCache
        self.fAnaMgr.fAnalysisFactory = self.fFactory
        self.fCacheMgr = ScanCacheMgr(self.fLog)
        self.fScanners = ScannerKit(self.fLog)
        self.fWaits = []

    def Patch(self, monkeypatch):
        """Scanner doubles, the recording logger and exception reports.  What is
        patched in refers to the call log only, not to the host, so that patches
        keep no coordinator alive."""
        self.fScanners.Install(monkeypatch)
        monkeypatch.setattr(_fastaccess, 'CLogger', RecordingLogger)
        log = self.fLog

        def report(*args):
            log.add('reflect', 'ReportCurrentException', sys.exc_info()[1], *args)

        monkeypatch.setattr(reflect, 'ReportCurrentException', report)
        return self

    def PatchWaitForInspect(self, monkeypatch, answer_now=None):
        """`location._WaitForInspectMultiple` records its requests in `fWaits` as
        (loc_seq, callback, force); with `answer_now` not None the callback is
        called with it before the call returns."""
        log, waits = self.fLog, self.fWaits

        def wait(loc_seq, callback, force=False):
            log.add('wait', '_WaitForInspectMultiple', loc_seq, force)
            waits.append((loc_seq, callback, force))
            if answer_now is not None:
                callback(answer_now)
        monkeypatch.setattr(location, '_WaitForInspectMultiple', wait)

    def Reports(self):
        """The exceptions reported through reflect, in order."""
        return [c.args[0] for c in self.fLog.find('reflect', 'ReportCurrentException')]


class HashSpyLocation(type(local('x.py'))):
    """A local file location that writes each hashing into a call log."""

    __slots__ = ('fSpyLog',)

    def __init__(self, path, log):
        super().__init__(path)
        self.fSpyLog = log

    def __hash__(self):
        self.fSpyLog.add('hash', self.fUrl.rpartition('/')[2])
        return super().__hash__()


# ---- the counting flavour ------------------------------------------------------------

class ScanCountingCoordinator(CountingCoordinator):
    """CountingCoordinator that also records the idle loop's operations."""

    def _CB_DoIdleAnalysis(self):
        self.fCalls.append(('_CB_DoIdleAnalysis',))
        return super()._CB_DoIdleAnalysis()

    def _CScanCoordinator__DoScans(self, end_time):
        self.fCalls.append(('__DoScans', end_time))
        return super()._CScanCoordinator__DoScans(end_time)

    def _CScanCoordinator__CheckWholeFiles(self, end_time):
        self.fCalls.append(('__CheckWholeFiles', end_time))
        return super()._CScanCoordinator__CheckWholeFiles(end_time)

    def _DoSingleScan(self, scan_item, end_time):
        self.fCalls.append(('_DoSingleScan', scan_item, end_time))
        return super()._DoSingleScan(scan_item, end_time)

    def _CScanCoordinator__GetAnalysis(self, loc, create):
        self.fCalls.append(('__GetAnalysis', loc, create))
        return super()._CScanCoordinator__GetAnalysis(loc, create)

    def _CScanCoordinator__GetModtimeDict(self, loc_seq):
        loc_seq = list(loc_seq)
        self.fCalls.append(('__GetModtimeDict', loc_seq))
        return super()._CScanCoordinator__GetModtimeDict(loc_seq)

    def _CScanCoordinator__DoPrimaryWholeFileScan(self, scan_item, end_time):
        self.fCalls.append(('__DoPrimaryWholeFileScan', scan_item, end_time))
        return super()._CScanCoordinator__DoPrimaryWholeFileScan(scan_item, end_time)

    def _CScanCoordinator__DoPrimarySingleScopeScan(self, scan_item, end_time):
        self.fCalls.append(('__DoPrimarySingleScopeScan', scan_item, end_time))
        return super()._CScanCoordinator__DoPrimarySingleScopeScan(scan_item, end_time)

    def _CScanCoordinator__DoSecondaryWholeFileScan(self, scan_item, end_time):
        self.fCalls.append(('__DoSecondaryWholeFileScan', scan_item, end_time))
        return super()._CScanCoordinator__DoSecondaryWholeFileScan(scan_item, end_time)

    def _CScanCoordinator__DoSecondarySingleScopeScan(self, loc, scope_name, end_time):
        self.fCalls.append(('__DoSecondarySingleScopeScan', loc, scope_name, end_time))
        return super()._CScanCoordinator__DoSecondarySingleScopeScan(loc, scope_name, end_time)

    def _CScanCoordinator__AddImportEquivsToQueue(self, imported_equivs, dirloc, priority):
        self.fCalls.append(('__AddImportEquivsToQueue', imported_equivs, dirloc, priority))
        return super()._CScanCoordinator__AddImportEquivsToQueue(imported_equivs, dirloc,
                                                                 priority)

    def _WaitForScannerToBeReady(self, scanner, scan_item):
        self.fCalls.append(('_WaitForScannerToBeReady', scanner, scan_item))
        return super()._WaitForScannerToBeReady(scanner, scan_item)

    def _CScanCoordinator__EnsureStatusTimeout(self):
        self.fCalls.append(('__EnsureStatusTimeout',))
        return super()._CScanCoordinator__EnsureStatusTimeout()

    def _CB_UpdateStatus(self):
        self.fCalls.append(('_CB_UpdateStatus',))
        return super()._CB_UpdateStatus()

    def GetStatus(self):
        self.fCalls.append(('GetStatus',))
        return super().GetStatus()

    def _ScheduleWriteToDatabaseIdle(self):
        self.fCalls.append(('_ScheduleWriteToDatabaseIdle',))
        return super()._ScheduleWriteToDatabaseIdle()

    def _CB_WriteToDatabase(self):
        self.fCalls.append(('_CB_WriteToDatabase',))
        return super()._CB_WriteToDatabase()


def is_counting(coord):
    return isinstance(coord, CountingCoordinator)


# ---- fixtures --------------------------------------------------------------------------

@pytest.fixture
def shost(host_reset, monkeypatch):
    h = ScanHost().Install().Patch(monkeypatch)
    yield h
    h.Destroy()


@pytest.fixture(params=['class', 'counting-subclass'])
def scoord_cls(request):
    return CScanCoordinator if request.param == 'class' else ScanCountingCoordinator


@pytest.fixture
def scoord(scoord_cls, shost):
    c = make_coord(scoord_cls, shost)
    yield c
    if not c._CDestroyable__fDestroyed:
        c.destroy()


# ---- running code under `python -O` ---------------------------------------------------

def run_optimised(body):
    """Run `body` (Python source) in a fresh `python -O` with this process's import
    path; it must print one JSON document as its last line, which is returned."""
    code = textwrap.dedent(body)
    env = dict(os.environ)
    env['PYTHONPATH'] = os.pathsep.join(p for p in sys.path if p)
    proc = subprocess.run([sys.executable, '-O', '-c', code], capture_output=True,
                          text=True, env=env, timeout=60, check=False)
    assert proc.returncode == 0, proc.stderr
    return json.loads(proc.stdout.strip().splitlines()[-1])


# ---- observing the coordinator -----------------------------------------------------------

kActiveFields = {
    PRIMARY_WHOLE: '_CScanCoordinator__fActivePrimaryWholeFileScanners',
    PRIMARY_SCOPE: '_CScanCoordinator__fActivePrimarySingleScopeScanners',
    SECONDARY_WHOLE: '_CScanCoordinator__fActiveSecondaryWholeFileScanners',
    SECONDARY_SCOPE: '_CScanCoordinator__fActiveSecondarySingleScopeScanners',
}


def active(coord, kind):
    """A copy of one of the coordinator's dictionaries of unfinished scanners."""
    return dict(getattr(coord, kActiveFields[kind]))


def data_waiting(coord):
    """The scan items parked until their scanner has its data."""
    return {tuple(item) for item in coord._fScanQueue._fScanItemsWaitingForData}


def timed_slice(coord):
    """Run one idle slice directly: (result, time before, time after)."""
    t0 = time.time()
    result = coord._CB_DoIdleAnalysis()
    return result, t0, time.time()


def pending_callbacks(coord, name):
    """The main loop's pending sources that would call `coord.<name>()`."""
    return [src for src in ostrelgtk.GetMainLoop()._fSources.values()
            if getattr(src.fCallback, '__name__', None) == name
            and getattr(src.fCallback, '__self__', None) is coord]


def take_over_idle(coord):
    """Remove the installed idle callback from the main loop, so that a test can call
    `_CB_DoIdleAnalysis` itself as the loop would (the id stays in `_fIdleProcId`)."""
    ostrelgtk.idle_remove(coord._fIdleProcId)
