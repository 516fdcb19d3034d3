"""Scripted stand-ins for the scan coordinator's collaborators, and test helpers.

Every double writes the calls made on it into one shared `CallLog`, so a test
can check the order of calls across collaborators (cache manager, helper proxy,
main loop, signals) as well as their arguments.  Answers come from plain
attributes the test sets; a double can be told to raise from one operation
(`Fail`), or to run a probe while one of its operations is being called
(`Probe`), which is how tests look at the coordinator's state mid-operation.

Signal emitters derive from the host's CDestroyable so that the coordinator
connects to them exactly as it does in the application.  Locations are the
stand-in host's own: `local()` makes a `CLocalFileLocation`, `remote()` a
remote-agent location (whose data arrives asynchronously).

The coordinator is tested in two flavours, the class itself and
`CountingCoordinator`, a Python subclass that overrides the overridable
operations, records each call and delegates to the base class; a test that
runs on the counting flavour can therefore check which of its own operations
the coordinator called and with what.
"""
import collections
import gc
import re
import weakref
from types import SimpleNamespace

import pytest
import singleton
from cache import textcache
from doubles import FakeGuiMgr, FakeLocationDataCache
from guiutils import ostrelgtk
from ostrelbase import containers, destroyable, location, remoteclient

from pysource import analysis, scancoordinator, scopeinfo

__all__ = [
    'coord',
    'coord_cls',
    'gtk_spy',
    'host',
    'host_reset',
]

PRIMARY = 'scope-primary'
DERIVED = 'scope-derived'
IDLE_PRIORITY = 150

CScanCoordinator = scancoordinator.CScanCoordinator
kTypingModulePriority = scancoordinator.kTypingModulePriority
kInteractivePriority = scancoordinator.kInteractivePriority
kBackgroundPriority = scancoordinator.kBackgroundPriority


def local(name):
    return location.CreateFromName(f'/src/{name}')


def remote(name):
    return location.CreateFromName(f'remote://build-host/src/{name}')


class Boom(Exception):
    """Raised by a double that was told to fail."""


# ---- the shared call log ------------------------------------------------------

Call = collections.namedtuple('Call', 'who what args kwargs')


class CallLog(list):
    """Calls made on the doubles, in order, as `Call(who, what, args, kwargs)`."""

    def add(self, who, what, *args, **kwargs):
        self.append(Call(who, what, args, kwargs))

    def find(self, who=None, what=None):
        return [c for c in self if (who is None or c.who == who)
                and (what is None or c.what == what)]

    def args(self, who, what):
        """The positional arguments of every call of `who.what`, in order."""
        return [c.args for c in self.find(who, what)]

    def names(self, who=None):
        return [(c.who, c.what) for c in self if who is None or c.who == who]


class _Scripted:
    """Recording, failing and probing for the doubles' operations."""

    def _InitScripted(self, log, who):
        self.fLog = log
        self.fWho = who
        self.fFailures = {}
        self.fProbes = {}

    def Fail(self, what, exc):
        """The next calls of `what` raise `exc` (None: stop failing)."""
        if exc is None:
            self.fFailures.pop(what, None)
        else:
            self.fFailures[what] = exc

    def Probe(self, what, fn):
        """Call `fn(*args, **kwargs)` whenever `what` is called (after recording)."""
        self.fProbes[what] = fn

    def _Record(self, what, *args, **kwargs):
        self.fLog.add(self.fWho, what, *args, **kwargs)
        probe = self.fProbes.get(what)
        if probe is not None:
            probe(*args, **kwargs)
        exc = self.fFailures.get(what)
        if exc is not None:
            raise exc


# ---- the analysis manager and what hangs off it ------------------------------------

class FakeModFileCache(destroyable.CDestroyable, _Scripted):
    """The factory's module file cache: only its "suspend"/"unsuspend" signals matter."""

    def __init__(self, log):
        destroyable.CDestroyable.__init__(self, ('suspend', 'unsuspend'))
        self._InitScripted(log, 'mod_file_cache')


class FakeAnalysisFactory(destroyable.CDestroyable, _Scripted):
    """Finds the builtins and typing modules from `fBuiltinMod`, `fLocsForName`
    and `fTypingLocs`."""

    def __init__(self, log):
        destroyable.CDestroyable.__init__(self, ('import-resolution-changed',))
        self._InitScripted(log, 'factory')
        self._fModFileCache = FakeModFileCache(log)
        self.fBuiltinMod = None
        self.fLocsForName = {}
        self.fTypingLocs = None

    def SetBuiltins(self, local_name, locs):
        self.fBuiltinMod = SimpleNamespace(fLocalName=local_name)
        self.fLocsForName[local_name] = list(locs)

    def FindBuiltinMod(self):
        self._Record('FindBuiltinMod')
        return self.fBuiltinMod

    def GetAllLocsForName(self, name, dirloc=None, include_extensions=False):
        self._Record('GetAllLocsForName', name, dirloc, include_extensions)
        # A generator: the caller must take what it needs while extending its list.
        return (loc for loc in self.fLocsForName.get(name, ()))

    def GetTypingLocations(self):
        self._Record('GetTypingLocations')
        return self.fTypingLocs

    def _destroy_impl(self):
        self._fModFileCache.destroy()


class FakeLocCache(_Scripted):
    """Answers `WantDerivedInfo` from `fAnswers` (loc -> any value), True otherwise."""

    def __init__(self, log):
        self._InitScripted(log, 'loc_cache')
        self.fAnswers = {}

    def WantDerivedInfo(self, loc):
        self._Record('WantDerivedInfo', loc)
        return self.fAnswers.get(loc, True)


class FakeInfoCache(scopeinfo.CInfoCache):
    """The host's information cache (the coordinator checks for that class) with a
    scripted location cache."""

    def __init__(self, log):
        super().__init__(PRIMARY, DERIVED, loc_cache=FakeLocCache(log))


class FakeHelperProxy(_Scripted):
    """The helper process's proxy: records the work handed to it."""

    def __init__(self, log):
        self._InitScripted(log, 'helper')
        self.fReceived = []

    def AddPairsToPrimaryQueue(self, pairs, *args, **kwargs):
        # The pairs object is recorded as given, with its items, so that a test can
        # check both what was sent and that the pairs themselves were passed on.
        items = list(pairs)
        self.fReceived.extend(items)
        self._Record('AddPairsToPrimaryQueue', items, *args, **kwargs)

    def FlushQueue(self, *args, **kwargs):
        self._Record('FlushQueue', *args, **kwargs)


class FakeAnalysisMgr:
    """The analysis manager: scan names, services, Python path and helper process."""

    def __init__(self, log, info_cache, data_cache, factory, python_path):
        self.fLog = log
        self.fPrimaryScanName = PRIMARY
        self.fDerivedScanName = DERIVED
        self.fInfoCache = info_cache
        self.fInferenceEngine = SimpleNamespace(name='inference engine')
        self.fLocationDataCache = data_cache
        self.fAnalysisFactory = factory
        self.fPyConfig = SimpleNamespace(python_path_locs=list(python_path))
        self.fHelperProcessProxy = None
        self._fHelperProcessSupport = None
        self.fScanCoordinator = None


# ---- application singletons ---------------------------------------------------------

class FakeCacheMgr(_Scripted):
    """Open buffers come from `fBuffers` (loc -> buffer)."""

    def __init__(self, log):
        self._InitScripted(log, 'cache_mgr')
        self.fBuffers = {}

    def OpenBuffer(self, loc):
        self.fBuffers[loc] = SimpleNamespace(fLocation=loc)

    def DoesCacheBufferExist(self, loc, loaded_only=True):
        self._Record('DoesCacheBufferExist', loc, loaded_only)
        return self.fBuffers.get(loc)

    def _ClearEOLBlindCacheAndScans(self):
        self._Record('_ClearEOLBlindCacheAndScans')

    def GetSourceForScan(self, loc):
        return None


class FakeSavableMgr(destroyable.CDestroyable):
    def __init__(self):
        destroyable.CDestroyable.__init__(self, ('external-files-changed',))


class FakeFileAttribMgr(_Scripted):
    """Probable mime types from `fMimeTypes` (loc -> mime type; None when absent)."""

    def __init__(self, log):
        self._InitScripted(log, 'file_attrib_mgr')
        self.fMimeTypes = {}

    def GetMultipleProbableMimeTypes(self, loc_dict):
        self._Record('GetMultipleProbableMimeTypes', list(loc_dict.items()))
        for loc in list(loc_dict):
            loc_dict[loc] = self.fMimeTypes.get(loc)
        return 'ignored'


class FakePrefMgr:
    pass


class FakeAnalysis(analysis.CPySourceAnalysis):
    """An analysis whose scopes per line come from `fScopeByLine` (lineno -> name)."""

    def __init__(self, loc, log, scope_by_line=None):
        self.fCallLog = log
        self.fScopeByLine = dict(scope_by_line or {})
        super().__init__(loc)

    def UpdateFromCache(self):
        pass

    def FindScopeContainingLine(self, lineno):
        self.fCallLog.add('analysis', 'FindScopeContainingLine', lineno)
        return self.fScopeByLine.get(lineno, '')


# ---- the whole host -------------------------------------------------------------

class CoordHost:
    """One set of collaborators for a coordinator, sharing one call log."""

    def __init__(self, python_path=True):
        self.fLog = CallLog()
        self.fDataCache = FakeLocationDataCache()
        self.fFactory = FakeAnalysisFactory(self.fLog)
        self.fModFileCache = self.fFactory._fModFileCache
        self.fInfoCache = FakeInfoCache(self.fLog)
        self.fLocCache = self.fInfoCache.fLocCache
        self.fHelper = FakeHelperProxy(self.fLog)
        self.fAnaMgr = FakeAnalysisMgr(self.fLog, self.fInfoCache, self.fDataCache,
                                       self.fFactory,
                                       [local('lib')] if python_path else [])
        self.fPrefMgr = FakePrefMgr()
        self.fCacheMgr = FakeCacheMgr(self.fLog)
        self.fSavableMgr = FakeSavableMgr()
        self.fFileAttribMgr = FakeFileAttribMgr(self.fLog)
        self.fGuiMgr = FakeGuiMgr()

    def Install(self):
        """Make these the application's managers."""
        for name, obj in (('fPrefMgr', self.fPrefMgr), ('fCacheMgr', self.fCacheMgr),
                          ('fSavableMgr', self.fSavableMgr),
                          ('fFileAttribMgr', self.fFileAttribMgr),
                          ('fGuiMgr', self.fGuiMgr), ('fAnalysisMgr', self.fAnaMgr)):
            singleton.SetSingleton(name, obj)
        return self

    def UseHelper(self, on=True):
        self.fAnaMgr.fHelperProcessProxy = self.fHelper if on else None

    def SetPythonPath(self, locs):
        self.fAnaMgr.fPyConfig.python_path_locs = list(locs)

    def Destroy(self):
        for obj in (self.fFactory, self.fInfoCache, self.fSavableMgr, self.fGuiMgr,
                    self.fDataCache):
            obj.destroy()


# ---- the coordinator flavours -------------------------------------------------------

class CountingCoordinator(CScanCoordinator):
    """Records every call of the overridable operations below in `fCalls`, as
    (name, arguments...) with default arguments filled in, then delegates."""

    def __init__(self, *args, **kwargs):
        self.fCalls = []
        super().__init__(*args, **kwargs)

    def Called(self, name):
        """The recorded argument tuples of every call of `name`, in order."""
        return [c[1:] for c in self.fCalls if c[0] == name]

    def Quitting(self):
        self.fCalls.append(('Quitting',))
        return super().Quitting()

    def _destroy_impl(self):
        self.fCalls.append(('_destroy_impl',))
        return super()._destroy_impl()

    def SuspendIdleScans(self):
        self.fCalls.append(('SuspendIdleScans',))
        return super().SuspendIdleScans()

    def ResumeIdleScans(self):
        self.fCalls.append(('ResumeIdleScans',))
        return super().ResumeIdleScans()

    def _CB_ActiveEditLinenoChanged(self, ana, new_lineno):
        self.fCalls.append(('_CB_ActiveEditLinenoChanged', ana, new_lineno))
        return super()._CB_ActiveEditLinenoChanged(ana, new_lineno)

    def _CB_NeedsScanAdded(self, info_cache, needs_scan_added, priority):
        self.fCalls.append(('_CB_NeedsScanAdded', info_cache, needs_scan_added, priority))
        return super()._CB_NeedsScanAdded(info_cache, needs_scan_added, priority)

    def AddNeedsScanSetToQueues(self, needs_scan_set):
        self.fCalls.append(('AddNeedsScanSetToQueues', needs_scan_set))
        return super().AddNeedsScanSetToQueues(needs_scan_set)

    def _QueueBasicModules(self, end_time):
        self.fCalls.append(('_QueueBasicModules', end_time))
        return super()._QueueBasicModules(end_time)

    def QueuesEmpty(self, include_waiting=True):
        self.fCalls.append(('QueuesEmpty', include_waiting))
        return super().QueuesEmpty(include_waiting)

    def AddParseablesToQueue(self, loc_seq, priority=kBackgroundPriority):
        loc_seq = list(loc_seq)
        self.fCalls.append(('AddParseablesToQueue', loc_seq, priority))
        return super().AddParseablesToQueue(loc_seq, priority)

    def _CanSendToHelperProcess(self, loc, scope_name):
        self.fCalls.append(('_CanSendToHelperProcess', loc, scope_name))
        return super()._CanSendToHelperProcess(loc, scope_name)

    def AddPairsToPrimaryQueue(self, pairs, first=True, priority=None):
        pairs = list(pairs)
        self.fCalls.append(('AddPairsToPrimaryQueue', pairs, first, priority))
        return super().AddPairsToPrimaryQueue(pairs, first, priority)

    def AddPairsToSecondaryQueue(self, pairs, first=True, priority=None):
        pairs = list(pairs)
        self.fCalls.append(('AddPairsToSecondaryQueue', pairs, first, priority))
        return super().AddPairsToSecondaryQueue(pairs, first, priority)

    def _CB_QueueLocationsAdded(self, queue, added):
        self.fCalls.append(('_CB_QueueLocationsAdded', queue, added))
        return super()._CB_QueueLocationsAdded(queue, added)

    def _ScheduleIdle(self):
        self.fCalls.append(('_ScheduleIdle',))
        return super()._ScheduleIdle()

    def _CancelIdle(self):
        self.fCalls.append(('_CancelIdle',))
        return super()._CancelIdle()

    def LocationInPrimaryScanQueue(self, loc):
        self.fCalls.append(('LocationInPrimaryScanQueue', loc))
        return super().LocationInPrimaryScanQueue(loc)

    def LocationInSecondaryScanQueue(self, loc):
        self.fCalls.append(('LocationInSecondaryScanQueue', loc))
        return super().LocationInSecondaryScanQueue(loc)

    def LocationInScanQueues(self, loc):
        self.fCalls.append(('LocationInScanQueues', loc))
        return super().LocationInScanQueues(loc)

    def RemoveLocationsFromQueue(self, to_remove):
        self.fCalls.append(('RemoveLocationsFromQueue', to_remove))
        return super().RemoveLocationsFromQueue(to_remove)

    def FlushQueue(self):
        self.fCalls.append(('FlushQueue',))
        return super().FlushQueue()


def counted(coord, name):
    """The calls of `name` that a counting coordinator recorded; None for the class
    itself, which records nothing."""
    return coord.Called(name) if isinstance(coord, CountingCoordinator) else None


def make_coord(cls, host, idle_priority=IDLE_PRIORITY):
    """A coordinator on `host`, with the scan orders the application sets."""
    coord = cls(idle_priority, host.fAnaMgr)
    coord._fScanQueue.SetScansToOrder({PRIMARY: 0, DERIVED: 1})
    return coord


# ---- fixtures -----------------------------------------------------------------------

@pytest.fixture(autouse=True)
def host_reset():
    """A fresh main loop and fresh singletons around every test."""
    ostrelgtk.reset()
    singleton.ResetSingletons()
    yield
    ostrelgtk.reset()
    singleton.ResetSingletons()


@pytest.fixture
def host(host_reset):
    h = CoordHost().Install()
    yield h
    h.Destroy()


@pytest.fixture(params=['class', 'counting-subclass'])
def coord_cls(request):
    return CScanCoordinator if request.param == 'class' else CountingCoordinator


@pytest.fixture
def coord(coord_cls, host):
    c = make_coord(coord_cls, host)
    yield c
    if not c._CDestroyable__fDestroyed:
        c.destroy()


class GtkSpy:
    """Wraps the main loop's idle and timeout calls, logging them as 'gtk' calls."""

    def __init__(self, monkeypatch, log):
        self.fLog = log
        for name in ('idle_add', 'idle_remove', 'timeout_add_while_alive', 'timeout_remove'):
            monkeypatch.setattr(ostrelgtk, name, self._Wrap(name, getattr(ostrelgtk, name)))

    def _Wrap(self, name, real):
        def spy(*args, **kwargs):
            result = real(*args, **kwargs)
            self.fLog.add('gtk', name, *args, result=result, **kwargs)
            return result
        return spy

    def IdleAdds(self, callback_name='_CB_DoIdleAnalysis'):
        """The idle_add calls for callbacks of that name (the scan queue's own
        deferred-signal idles are left out)."""
        return [c for c in self.fLog.find('gtk', 'idle_add')
                if getattr(c.args[0], '__name__', None) == callback_name]


@pytest.fixture
def gtk_spy(monkeypatch, host):
    return GtkSpy(monkeypatch, host.fLog)


# ---- observing the coordinator --------------------------------------------------------

def pending_idle(sid):
    """The main loop's pending idle source with that id, or None."""
    src = ostrelgtk.GetMainLoop()._fSources.get(sid)
    return src if src is not None and src.fIntervalMs is None else None


def analysis_idles(coord):
    """The pending idle sources that would run the coordinator's idle analysis."""
    return [src for src in ostrelgtk.GetMainLoop()._fSources.values()
            if src.fIntervalMs is None and getattr(src.fCallback, '__name__', None)
            == '_CB_DoIdleAnalysis' and getattr(src.fCallback, '__self__', None) is coord]


def record_signals(coord, log, *signals, probe=None):
    """Log each emission of `signals` by `coord` as ('signal', name, args), with
    `probe()`'s result as the keyword `state` when given."""
    def recorder(signal):
        def record(*args):
            if probe is None:
                log.add('signal', signal, *args)
            else:
                log.add('signal', signal, *args, state=probe())
        return record
    for signal in signals:
        coord.connect(signal, recorder(signal))


def _scan_queue(obj):
    return obj._fScanQueue if isinstance(obj, CScanCoordinator) else obj


def queued(obj):
    """Every ready scan of a coordinator's (or a scan queue's) queue:
    {(loc, scope, scan name): priority}."""
    return {(loc, scope, scan): priority
            for loc, (_counts, pending) in _scan_queue(obj)._fPerLocationInfo.items()
            for (scope, scan), priority in pending.items()}


def waiting(obj):
    """Every scan parked until its location is inspected, as 4-tuples."""
    return {tuple(item) for items, _check in _scan_queue(obj)._fWaitingForInspectByLoc.values()
            for item in items}


# ---- the host's connection records --------------------------------------------------

ConnInfo = collections.namedtuple('ConnInfo', 'id emitter signal handler owner ended')

_kConnRepr = re.compile(r"<_Connection (\d+): (?:'([^']*)'|destroy hook)(.*)>")


def handler_label(callback, coord):
    """A readable name for a handler: 'self.X' for a method of the coordinator,
    'NoArg(f)' / 'NoObj(f)' for the host's adapters, else the function's name."""
    if isinstance(callback, ostrelgtk.NoArgCallback):
        return f'NoArg({handler_label(callback.fFunc, coord)})'
    if isinstance(callback, ostrelgtk.NoObjCallback):
        return f'NoObj({handler_label(callback.fFunc, coord)})'
    name = getattr(callback, '__name__', repr(callback))
    if getattr(callback, '__self__', None) is coord:
        return f'self.{name}'
    return name


def describe_connection(conn, emitter_label, coord):
    """ConnInfo of one of the host's connection records, read from its repr and
    from what it refers to (its callback, and weak references to emitter/owner)."""
    m = _kConnRepr.match(repr(conn))
    assert m, repr(conn)
    refs = gc.get_referents(conn)
    weak = [r() for r in refs if isinstance(r, weakref.ReferenceType)]
    callbacks = [r for r in refs if callable(r) and not isinstance(r, weakref.ReferenceType)]
    assert len(callbacks) <= 1, refs
    handler = handler_label(callbacks[0], coord) if callbacks else None
    owner = 'coord' if any(w is coord for w in weak[1:]) else ('other' if weak[1:] else None)
    return ConnInfo(int(m.group(1)), emitter_label, m.group(2), handler, owner,
                    m.group(3).endswith('ended'))


def instance_connections(emitter, label, coord):
    """The connections made on `emitter`, as ConnInfo, in the order they were made."""
    catchers = emitter._CDestroyable__fSignalCatchers or {}
    infos = [describe_connection(conn, label, coord)
             for conns in catchers.values() for conn in conns]
    return sorted(infos)


class ClassConnectSpy:
    """Wraps `class_connect_while_alive` of the classes the coordinator follows
    class-wide, recording ConnInfo of each connection made."""

    kClasses = (analysis.CPySourceAnalysis, textcache.CTextCache,
                remoteclient.CRemoteServerManager, containers.CContainerInspectorManager)

    def __init__(self, monkeypatch):
        self.fMade = []
        for cls in self.kClasses:
            monkeypatch.setattr(cls, 'class_connect_while_alive',
                                staticmethod(self._Wrap(cls, cls.class_connect_while_alive)))

    def _Wrap(self, cls, real):
        def spy(signal, callback, owner):
            cid = real(signal, callback, owner)
            self.fMade.append((cid, cls.__name__, signal, callback, owner))
            return cid
        return spy

    def Connections(self, coord):
        return [ConnInfo(cid, cls_name, signal, handler_label(callback, coord),
                         'coord' if owner is coord else 'other', False)
                for cid, cls_name, signal, callback, owner in self.fMade]
