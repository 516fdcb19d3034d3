"""Scripted stand-ins for the scan coordinator's collaborators.

Every double records its calls in one shared `CallLog` (so a test can check the
order of calls across collaborators), answers from attributes the test sets,
and can be told to raise (`Fail`) or to run a probe when called (`Probe`).
`Host.Patch` replaces the scanner classes the coordinator looks up on
`pysource.scopescanner` with scripted ones (each `Scan` answers the next entry of
its script: a state, an exception to raise, or `fn(scanner, end_time)`; the last
repeats), the logger with a `RecordingLogger`, and the exception reporter.
"""
import collections
import io
import re
import sys
import time
from types import SimpleNamespace

import pytest
import singleton
from doubles import FakeGuiMgr, FakeLocationDataCache
from guiutils import ostrelgtk
from ostrelbase import destroyable, location
from ostrelutils import reflect

from pysource import _fastaccess, analysis, scancoordinator, scopeinfo, scopescanner, symbolinfo

__all__ = ['DERIVED', 'IDLE_PRIORITY', 'PRIMARY', 'PRIMARY_SCOPE', 'PRIMARY_WHOLE',
           'SECONDARY_SCOPE', 'SECONDARY_WHOLE', 'Analysis', 'Boom', 'CScanCoordinator',
           'CScanItem', 'FileAttribMgr', 'Host', 'active', 'add_incomplete', 'class_def',
           'data_waiting', 'end_in', 'helper_callback_class', 'kFinishedScanning', 'kReadyToScan',
           'kScanAbandoned', 'kTimedOut', 'kWaitingForData', 'local', 'make_coord', 'method_def',
           'pending_callbacks', 'queued', 'record_signals', 'remote', 'scope_info', 'signals_of',
           'take_over_idle', 'waiting']

PRIMARY = 'scope-primary'
DERIVED = 'scope-derived'
IDLE_PRIORITY = 150
CScanCoordinator = scancoordinator.CScanCoordinator
CScanItem = scancoordinator.CScanItem
kReadyToScan = scopescanner.kReadyToScan
kWaitingForData = scopescanner.kWaitingForData
kFinishedScanning = scopescanner.kFinishedScanning
kTimedOut = scopescanner.kTimedOut
kScanAbandoned = scopescanner.kScanAbandoned


def local(name):
    return location.CreateFromName(f'/src/{name}')


def remote(name):
    return location.CreateFromName(f'remote://build-host/src/{name}')


class Boom(Exception):
    """Raised by a double that was told to fail."""


Call = collections.namedtuple('Call', 'who what args kwargs')


class CallLog(list):
    def add(self, who, what, *args, **kwargs):
        self.append(Call(who, what, args, kwargs))

    def find(self, who=None, what=None):
        return [c for c in self if who in (None, c.who) and what in (None, c.what)]

    def args(self, who, what):
        return [c.args for c in self.find(who, what)]


class Scripted:
    def _InitScripted(self, log, who):
        self.fLog, self.fWho, self.fFailures, self.fProbes = log, who, {}, {}

    def Fail(self, what, exc):
        """The next calls of `what` raise `exc` (None: stop failing)."""
        self.fFailures[what] = exc

    def Probe(self, what, fn):
        self.fProbes[what] = fn

    def _Record(self, what, *args, **kwargs):
        self.fLog.add(self.fWho, what, *args, **kwargs)
        if what in self.fProbes:
            self.fProbes[what](*args, **kwargs)
        if self.fFailures.get(what) is not None:
            raise self.fFailures[what]


PRIMARY_WHOLE, PRIMARY_SCOPE = 'CWholeFilePrimaryScanner', 'CSingleScopePrimaryScanner'
SECONDARY_WHOLE, SECONDARY_SCOPE = 'CWholeFileSecondaryScanner', 'CSingleScopeSecondaryScanner'


def add_incomplete(names, state=kFinishedScanning):
    """A script entry that adds scope names to the scanner's incomplete set."""
    def step(scanner, end_time):
        scanner.fKwargs['incomplete_scope_set'].update(names)
        return state
    return step


class _Scanner:
    kKind = fKit = None

    def _Setup(self, key, args, kwargs):
        destroyable.CDestroyable.__init__(self, ('scan-state-changed',))
        self.fKey, self.fArgs, self.fKwargs = key, args, kwargs
        script = self.fKit.fScripts.get((self.kKind, key)) or self.fKit.Script(None, None)
        self.fScript, self.fStates = script, list(script.states)
        self.fInfo, self.fScopeDef = script.info, script.scope_def
        self.fContainingClassDef = script.containing_class_def
        self.fFileDoesntExist = script.file_doesnt_exist
        self.fScans, self.fSaves, self.fDestroyCount = [], [], 0
        self.fKit.fCreated.append(self)
        self.fKit.fLog.add('scanner', 'create', self.kKind, key)

    def __repr__(self):
        return f'<{self.kKind} of {self.fKey!r}>'

    def Scan(self, end_time):
        self.fKit.fLog.add('scanner', 'Scan', self.kKind, self.fKey, end_time)
        step = self.fStates.pop(0) if len(self.fStates) > 1 else self.fStates[0]
        self.fScans.append(end_time)
        if isinstance(step, BaseException):
            raise step
        return step(self, end_time) if callable(step) else step

    def SaveToInfoCache(self, *args):
        self.fSaves.append(args)
        self.fKit.fLog.add('scanner', 'SaveToInfoCache', self.kKind, self.fKey)
        return self.fScript.changed

    def _destroy_impl(self):
        self.fDestroyCount += 1
        self.fKit.fLog.add('scanner', 'destroy', self.kKind, self.fKey)

    def Connections(self):
        return sum(len(c) for c in (self._CDestroyable__fSignalCatchers or {}).values())


class _WholeFilePrimary(_Scanner, destroyable.CDestroyable):
    def __init__(self, loc, scan_name, *, incomplete_scope_set, log):
        self._Setup(loc, (loc, scan_name), {'incomplete_scope_set': incomplete_scope_set,
                                            'log': log})


class _SingleScopePrimary(_Scanner, destroyable.CDestroyable):
    def __init__(self, loc, scope_name, *, incomplete_scope_set, log):
        self._Setup((loc, scope_name), (loc, scope_name),
                    {'incomplete_scope_set': incomplete_scope_set, 'log': log})


class _WholeFileSecondary(_Scanner, scopescanner.CScanner):
    def __init__(self, loc, scan_name, log, /):
        self._Setup(loc, (loc, scan_name, log), {})


class _SingleScopeSecondary(_Scanner, destroyable.CDestroyable):
    def __init__(self, scope_info, log, ctx, ana_mgr, /):
        self._Setup((scope_info.key.loc, scope_info.key.scope_name),
                    (scope_info, log, ctx, ana_mgr), {})


class ScannerKit:
    def __init__(self, log):
        self.fLog, self.fScripts, self.fCreated = log, {}, []
        bases = {PRIMARY_WHOLE: _WholeFilePrimary, PRIMARY_SCOPE: _SingleScopePrimary,
                 SECONDARY_WHOLE: _WholeFileSecondary, SECONDARY_SCOPE: _SingleScopeSecondary}
        self.fClasses = {kind: type(kind, (base,), {'fKit': self, 'kKind': kind})
                         for kind, base in bases.items()}

    def Script(self, kind, key, states=(kFinishedScanning,), info=None, scope_def=None,
               containing_class_def=None, file_doesnt_exist=False, changed=True):
        self.fScripts[(kind, key)] = script = SimpleNamespace(
            states=list(states), info=info, scope_def=scope_def, changed=changed,
            containing_class_def=containing_class_def, file_doesnt_exist=file_doesnt_exist)
        return script

    def Made(self, kind=None):
        return [s for s in self.fCreated if kind in (None, s.kKind)]

    def One(self, kind=None):
        [made] = self.Made(kind)
        return made


def scope_info(loc, scope_name, type_equivs=None, def_info=b'', mtime=100.0):
    key = scopeinfo.CScopeInfoKey(loc, scope_name, PRIMARY, loc, scope_name)
    return scopeinfo.CScopeInfo(key, def_info, mtime, False, False, type_equivs or {})


def method_def(scope_name, bound=False):
    prefix = symbolinfo.kMethodPrefix if bound else symbolinfo.kUnboundMethodPrefix
    return symbolinfo.PackDefInfoStr(prefix, scope_name, 3, 5, ('self',))


def class_def(scope_name):
    return symbolinfo.PackDefInfoStr(symbolinfo.kClassPrefix, scope_name, 1, 9)


class LocCache(Scripted):
    """Answers `WantDerivedInfo` from `fAnswers` (default True)."""

    def __init__(self, log):
        self._InitScripted(log, 'loc_cache')
        self.fAnswers = {}
        self.fBuiltinLoc = local('stubs/builtins.pyi')

    def WantDerivedInfo(self, loc):
        self._Record('WantDerivedInfo', loc)
        return self.fAnswers.get(loc, True)

    def GetBuiltinLoc(self):
        self._Record('GetBuiltinLoc')
        return self.fBuiltinLoc


class InfoCache(scopeinfo.CInfoCache, Scripted):
    """`fMTimes` (loc -> disk time, default 100.0), `fScansDone` (loc -> string; or the
    whole answer in `fScansDoneResult`), `fImports` (loc -> equivalents), `fScopeInfos`
    ((loc, scope) -> info; None for any other pair unless `fMakeInfos`)."""

    def __init__(self, log):
        scopeinfo.CInfoCache.__init__(self, PRIMARY, DERIVED, loc_cache=LocCache(log))
        self._InitScripted(log, 'info_cache')
        self.fMTimes, self.fScansDone, self.fImports, self.fScopeInfos = {}, {}, {}, {}
        self.fScansDoneResult = None
        self.fMakeInfos, self.fStore, self.fAdded = True, True, []

    def GetScansDoneForMultipleFiles(self, mtime_dict):
        self._Record('GetScansDoneForMultipleFiles', dict(mtime_dict))
        if self.fScansDoneResult is not None:
            return self.fScansDoneResult
        return {loc: self.fScansDone.get(loc, '') for loc in mtime_dict}

    def GetAllImports(self, loc_list):
        self._Record('GetAllImports', list(loc_list))
        return [(loc, 'scope', eq) for loc in loc_list for eq in self.fImports.get(loc, ())]

    def GetDiskMTime(self, loc):
        self._Record('GetDiskMTime', loc)
        return self.fMTimes.get(loc, 100.0)

    def GetScopeInfo(self, loc, scope_name):
        self._Record('GetScopeInfo', loc, scope_name)
        if (loc, scope_name) not in self.fScopeInfos and self.fMakeInfos:
            self.fScopeInfos[(loc, scope_name)] = scope_info(loc, scope_name)
        return self.fScopeInfos.get((loc, scope_name))

    def Put(self, info):
        self.fScopeInfos[(info.key.loc, info.key.scope_name)] = info
        return info

    def AddScopeInfo(self, info):
        self._Record('AddScopeInfo', info)
        self.fAdded.append(info)
        if self.fStore:
            self.Put(info)

    def FinishedWithScans(self, loc, scope_name, scan_name):
        self._Record('FinishedWithScans', loc, scope_name, scan_name)

    def Trim(self):
        self._Record('Trim')

    def WriteToDatabase(self):
        self._Record('WriteToDatabase')


class AnalysisFactory(destroyable.CDestroyable, Scripted):
    """Builtins from `fBuiltinMod`/`fLocsForName`, typing modules from `fTypingLocs`,
    module files from `fModuleLocs`, secondary locations from `fSecondaryLocs`."""

    def __init__(self, log):
        destroyable.CDestroyable.__init__(self, ('import-resolution-changed',))
        self._InitScripted(log, 'factory')
        self._fModFileCache = destroyable.CDestroyable(('suspend', 'unsuspend'))
        self.fBuiltinMod, self.fTypingLocs = None, None
        self.fLocsForName, self.fModuleLocs, self.fSecondaryLocs = {}, {}, {}

    def SetBuiltins(self, name, locs):
        self.fBuiltinMod = SimpleNamespace(fLocalName=name)
        self.fLocsForName[name] = list(locs)

    def FindBuiltinMod(self):
        self._Record('FindBuiltinMod')
        return self.fBuiltinMod

    def GetAllLocsForName(self, name, dirloc=None, include_extensions=False):
        self._Record('GetAllLocsForName', name, dirloc, include_extensions)
        return (loc for loc in self.fLocsForName.get(name, ()))

    def GetTypingLocations(self):
        self._Record('GetTypingLocations')
        return self.fTypingLocs

    def _FindPrimaryLocsForNames(self, names, dirloc, flag):
        self._Record('_FindPrimaryLocsForNames', set(names), dirloc, flag)
        return [self.fModuleLocs.get(name) for name in sorted(names)]

    def GetSecondaryLocations(self, loc):
        self._Record('GetSecondaryLocations', loc)
        return self.fSecondaryLocs.get(loc)

    def _destroy_impl(self):
        self._fModFileCache.destroy()


class Buffer(Scripted):
    def __init__(self, log, loc, modified, mtime):
        self._InitScripted(log, 'buffer')
        self.fLocation, self.fModified, self.fMTime = loc, modified, mtime

    def IsModified(self):
        self._Record('IsModified', self.fLocation)
        return self.fModified

    def _GetLastKnownModTime(self):
        self._Record('_GetLastKnownModTime', self.fLocation)
        return self.fMTime


class CacheMgr(Scripted):
    """Open buffers from `fBuffers`, analysis objects from `fAnalyses`."""

    def __init__(self, log):
        self._InitScripted(log, 'cache_mgr')
        self.fBuffers, self.fAnalyses = {}, {}

    def OpenBuffer(self, loc, modified=False, mtime=50.0):
        self.fBuffers[loc] = Buffer(self.fLog, loc, modified, mtime)

    def DoesCacheBufferExist(self, loc, loaded_only=True):
        self._Record('DoesCacheBufferExist', loc, loaded_only)
        return self.fBuffers.get(loc)

    def _ClearEOLBlindCacheAndScans(self):
        self._Record('_ClearEOLBlindCacheAndScans')

    def GetAnalysis(self, loc, create):
        self._Record('GetAnalysis', loc, create)
        return self.fAnalyses.get(loc)

    def GetSourceForScan(self, loc):
        return None


class FileAttribMgr(Scripted):
    def __init__(self, log):
        self._InitScripted(log, 'file_attrib_mgr')
        self.fMimeTypes = {}

    def GetMultipleProbableMimeTypes(self, loc_dict):
        self._Record('GetMultipleProbableMimeTypes', list(loc_dict.items()))
        for loc in list(loc_dict):
            loc_dict[loc] = self.fMimeTypes.get(loc)


class HelperProxy(Scripted):
    def __init__(self, log):
        self._InitScripted(log, 'helper')

    def AddPairsToPrimaryQueue(self, pairs, *args, **kwargs):
        self._Record('AddPairsToPrimaryQueue', list(pairs), *args, **kwargs)

    def FlushQueue(self, *args, **kwargs):
        self._Record('FlushQueue', *args, **kwargs)


class Analysis(analysis.CPySourceAnalysis):
    """An analysis whose scopes per line come from `fScopeByLine`."""

    def __init__(self, loc, log, scope_by_line=None):
        self.fCallLog, self.fScopeByLine, self.fBuilt = log, dict(scope_by_line or {}), False
        super().__init__(loc)
        self.fBuilt = True

    def UpdateFromCache(self):
        if self.fBuilt:
            self.fCallLog.add('analysis', 'UpdateFromCache', self.fLocation)

    def FindScopeContainingLine(self, lineno):
        self.fCallLog.add('analysis', 'FindScopeContainingLine', lineno)
        return self.fScopeByLine.get(lineno, '')


class Engine(Scripted):
    """The inference engine: scope information from `fInfos`; the contexts'
    `OutOfTime()` answers come from `fOutOfTime` in order (the last repeats)."""

    def __init__(self, log):
        self._InitScripted(log, 'engine')
        self.fInfos, self.fOutOfTime, self.fContexts = {}, [False], []

    def NewContext(self, end_time):
        self._Record('NewContext', end_time)
        engine = self
        ctx = SimpleNamespace(fEndTime=end_time, OutOfTime=lambda: (
            engine.fOutOfTime.pop(0) if len(engine.fOutOfTime) > 1 else engine.fOutOfTime[0]))
        self.fContexts.append(ctx)
        return ctx

    def GetScopeInfo(self, loc, scope_name, ctx):
        self._Record('GetScopeInfo', loc, scope_name, ctx)
        return self.fInfos.get((loc, scope_name))


class RecordingLogger(_fastaccess.CLogger):
    """Records every call as (format, values); logging is on (an in-memory file)."""

    fOutputFile = None

    def __init__(self, category):
        super().__init__(category)
        self.fCalls, self.fOutputFile = [], io.StringIO()

    def __call__(self, msg, *values):
        self.fCalls.append((msg, values))

    def Texts(self):
        return [msg % values if values else msg for msg, values in self.fCalls]

    def Messages(self):
        """The coordinator's own messages, without the queue listing."""
        return [t for t in self.Texts()
                if not t.startswith(('_CScanQueue contents:', ' ', 'Waiting for '))]


class AnaMgr(SimpleNamespace):
    """The analysis manager: scan names, services, Python path, helper process."""


class Host:
    """One set of collaborators for a coordinator, sharing one call log."""

    def __init__(self):
        log = self.fLog = CallLog()
        self.fDataCache = FakeLocationDataCache()
        self.fFactory = AnalysisFactory(log)
        self.fModFileCache = self.fFactory._fModFileCache
        self.fInfoCache = InfoCache(log)
        self.fLocCache = self.fInfoCache.fLocCache
        self.fHelper = HelperProxy(log)
        self.fEngine = Engine(log)
        self.fAnaMgr = AnaMgr(
            fPrimaryScanName=PRIMARY, fDerivedScanName=DERIVED, fInfoCache=self.fInfoCache,
            fInferenceEngine=self.fEngine, fLocationDataCache=self.fDataCache,
            fAnalysisFactory=self.fFactory, fHelperProcessProxy=None,
            fPyConfig=SimpleNamespace(python_path_locs=[local('lib')]),
            _fHelperProcessSupport=None, fScanCoordinator=None)
        self.fCacheMgr = CacheMgr(log)
        self.fSavableMgr = destroyable.CDestroyable(('external-files-changed',))
        self.fFileAttribMgr = FileAttribMgr(log)
        self.fGuiMgr = FakeGuiMgr()
        self.fScanners = ScannerKit(log)
        for name, obj in (('fPrefMgr', object()), ('fCacheMgr', self.fCacheMgr),
                          ('fSavableMgr', self.fSavableMgr),
                          ('fFileAttribMgr', self.fFileAttribMgr), ('fGuiMgr', self.fGuiMgr),
                          ('fAnalysisMgr', self.fAnaMgr)):
            singleton.SetSingleton(name, obj)

    def Patch(self, monkeypatch):
        """Scanner doubles, the recording logger and exception reports; what is patched
        in refers to the call log only, so that it keeps no coordinator alive."""
        for kind, cls in self.fScanners.fClasses.items():
            monkeypatch.setattr(scopescanner, kind, cls)
        monkeypatch.setattr(_fastaccess, 'CLogger', RecordingLogger)
        log = self.fLog
        monkeypatch.setattr(reflect, 'ReportCurrentException',
                            lambda *args: log.add('reflect', 'report', sys.exc_info()[1]))
        return self

    def UseHelper(self, on=True):
        self.fAnaMgr.fHelperProcessProxy = self.fHelper if on else None

    def SetPythonPath(self, locs):
        self.fAnaMgr.fPyConfig.python_path_locs = list(locs)

    def Reports(self):
        return [c.args[0] for c in self.fLog.find('reflect')]

    def Destroy(self):
        for obj in (self.fFactory, self.fInfoCache, self.fSavableMgr, self.fGuiMgr,
                    self.fDataCache):
            obj.destroy()


def make_coord(host, cls=CScanCoordinator, idle_priority=IDLE_PRIORITY):
    """A coordinator on `host`, with the scan orders the application sets."""
    coord = cls(idle_priority, host.fAnaMgr)
    coord._fScanQueue.SetScansToOrder({PRIMARY: 0, DERIVED: 1})
    return coord


@pytest.fixture
def host(monkeypatch):
    h = Host().Patch(monkeypatch)
    yield h
    h.Destroy()


@pytest.fixture
def coord(host):
    c = make_coord(host)
    yield c
    if not c._CDestroyable__fDestroyed:
        c.destroy()


def queued(coord):
    """Every ready scan: {(loc, scope, scan name): priority}."""
    return {(loc, scope, scan): priority
            for loc, (_counts, pending) in coord._fScanQueue._fPerLocationInfo.items()
            for (scope, scan), priority in pending.items()}


def waiting(coord):
    """Every scan parked until its location is inspected, as 4-tuples."""
    return {tuple(item) for items, _check in coord._fScanQueue._fWaitingForInspectByLoc.values()
            for item in items}


def data_waiting(coord):
    return {tuple(item) for item in coord._fScanQueue._fScanItemsWaitingForData}


def active(coord, kind):
    """The coordinator's unfinished scanners of that kind (PRIMARY_WHOLE, ...)."""
    pattern = r'C(WholeFile|SingleScope)(Primary|Secondary)Scanner'
    extent, role = re.fullmatch(pattern, kind).groups()
    return dict(getattr(coord, f'_CScanCoordinator__fActive{role}{extent}Scanners'))


def pending_callbacks(coord, name='_CB_DoIdleAnalysis'):
    """The main loop's pending sources that would call `coord.<name>()`."""
    return [src for src in ostrelgtk.GetMainLoop()._fSources.values()
            if getattr(src.fCallback, '__name__', None) == name
            and getattr(src.fCallback, '__self__', None) is coord]


def record_signals(coord, log, *signals, probe=None):
    """Log each emission as ('signal', name, args), with `probe()` as keyword `state`."""
    def recorder(signal):
        def record(*args):
            log.add('signal', signal, *args, **({} if probe is None else {'state': probe()}))
        return record
    for signal in signals:
        coord.connect(signal, recorder(signal))


def signals_of(log):
    return [c.what for c in log.find('signal')]


def take_over_idle(coord):
    """Remove the installed idle from the main loop, so that a test can call
    `_CB_DoIdleAnalysis` itself (the id stays in `_fIdleProcId`)."""
    ostrelgtk.idle_remove(coord._fIdleProcId)


def helper_callback_class(name='HelperCallbacks'):
    """A new class of helper callback objects, recording its class-wide connections."""
    def class_connect_while_alive(cls, signal, callback, owner):
        cls.fConnects.append((signal, callback, owner))
        real = destroyable.CDestroyable.__dict__['class_connect_while_alive']
        return real.__get__(None, cls)(signal, callback, owner)

    return type(name, (destroyable.CDestroyable,), {
        '__init__': lambda self: destroyable.CDestroyable.__init__(
            self, ('scan-queue-locs-added', 'scan-queue-locs-removed')),
        'fConnects': [], 'class_connect_while_alive': classmethod(class_connect_while_alive)})


def end_in(seconds=5.0):
    return time.time() + seconds
