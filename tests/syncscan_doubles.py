"""Doubles for the coordinator's synchronous scans and its helper-process support.

`SyncHost` is scan_doubles' ScanHost with an information cache that holds only
what a test stores (`StoreInfoCache`) and a scripted inference engine
(`FakeInferenceEngine`), both writing into the shared call log.  Its
coordinators come in two flavours, the class and `SyncCountingCoordinator`,
which also records the synchronous-scan operations that the coordinator
reaches through its overridable entries (`TryToScanNow` and the instance-scope
builders), so a test can see the calls one operation makes on another.

`helper_callback_class()` makes a fresh class for the helper process's
callback object; each such class records the class-wide connections made on
it, and being new per test it shares no class-wide handlers with other tests.
"""
import pytest
from coord_doubles import PRIMARY, _Scripted, host_reset, make_coord
from ostrelbase import destroyable
from scan_doubles import ScanCountingCoordinator, ScanHost, ScanInfoCache

from pysource import scancoordinator, scopeinfo, symbolinfo

__all__ = [
    'host_reset',
    'sync_cls',
    'synccoord',
    'synchost',
]

kHelperSignals = ('scan-queue-locs-added', 'scan-queue-locs-removed')


# ---- scope information ---------------------------------------------------------------------

def method_def(scope_name, bound=False, args=('self',)):
    """The packed definition of a method, as a class scope's equivalents hold it."""
    prefix = symbolinfo.kMethodPrefix if bound else symbolinfo.kUnboundMethodPrefix
    return symbolinfo.PackDefInfoStr(prefix, scope_name, 3, 5, args)


def class_def(scope_name):
    return symbolinfo.PackDefInfoStr(symbolinfo.kClassPrefix, scope_name, 1, 9)


def scope_info(loc, scope_name, type_equivs=None, def_info=b'', mtime=100.0,
               scan_name=PRIMARY):
    key = scopeinfo.CScopeInfoKey(loc, scope_name, scan_name, loc, scope_name)
    return scopeinfo.CScopeInfo(key, def_info, mtime, False, False, type_equivs or {})


class StoreInfoCache(ScanInfoCache):
    """Answers `GetScopeInfo` only from `fScopeInfos` (None for any other pair)
    and records `AddScopeInfo`, storing the information under its key's pair
    unless `fStore` is false."""

    def __init__(self, log):
        super().__init__(log)
        self.fAdded = []
        self.fStore = True

    def GetScopeInfo(self, loc, scope_name):
        self._Record('GetScopeInfo', loc, scope_name)
        return self.fScopeInfos.get((loc, scope_name))

    def AddScopeInfo(self, info):
        self._Record('AddScopeInfo', info)
        self.fAdded.append(info)
        if self.fStore:
            self.fScopeInfos[(info.key.loc, info.key.scope_name)] = info

    def Put(self, info):
        self.fScopeInfos[(info.key.loc, info.key.scope_name)] = info
        return info


# ---- the inference engine ------------------------------------------------------------------

class FakeContext(_Scripted):
    """An inference context; `OutOfTime()` answers from the engine's script."""

    def __init__(self, engine, end_time):
        self._InitScripted(engine.fLog, 'context')
        self.fEngine = engine
        self.fEndTime = end_time

    def OutOfTime(self):
        self._Record('OutOfTime')
        answers = self.fEngine.fOutOfTime
        return answers.pop(0) if len(answers) > 1 else answers[0]


class FakeInferenceEngine(_Scripted):
    """Scope information by inference from `fInfos` ((loc, scope) -> info, else
    None).  `fOutOfTime` scripts the answers of the contexts' `OutOfTime()`
    calls, in order; the last one repeats."""

    def __init__(self, log):
        self._InitScripted(log, 'engine')
        self.fInfos = {}
        self.fOutOfTime = [False]
        self.fContexts = []

    def NewContext(self, end_time):
        self._Record('NewContext', end_time)
        ctx = FakeContext(self, end_time)
        self.fContexts.append(ctx)
        return ctx

    def GetScopeInfo(self, loc, scope_name, ctx):
        self._Record('GetScopeInfo', loc, scope_name, ctx)
        return self.fInfos.get((loc, scope_name))


# ---- the host ----------------------------------------------------------------------------

class SyncHost(ScanHost):
    """ScanHost with a storing information cache and a scripted inference engine."""

    def __init__(self):
        super().__init__()
        self.fInfoCache.destroy()
        self.fInfoCache = StoreInfoCache(self.fLog)
        self.fLocCache = self.fInfoCache.fLocCache
        self.fAnaMgr.fInfoCache = self.fInfoCache
        self.fEngine = FakeInferenceEngine(self.fLog)
        self.fAnaMgr.fInferenceEngine = self.fEngine


# ---- the counting flavour ------------------------------------------------------------------

class SyncCountingCoordinator(ScanCountingCoordinator):
    """ScanCountingCoordinator that also records the synchronous-scan operations.
    `TryToScanNow` records, besides its arguments, the two triple sets as they
    are when it is called."""

    def TryToScanNow(self, loc, scope_name, scan_name_list, end_time, do_secondary=True):
        self.fCalls.append(('TryToScanNow', loc, scope_name, scan_name_list, end_time,
                            do_secondary))
        self.fCalls.append(('sets at TryToScanNow', set(self._fActiveScanNowTriples),
                            set(self._fPendingScanNowTriples)))
        return super().TryToScanNow(loc, scope_name, scan_name_list, end_time, do_secondary)

    def _TryToScanInstanceScopeNow(self, loc, scope_name, end_time):
        self.fCalls.append(('_TryToScanInstanceScopeNow', loc, scope_name, end_time))
        return super()._TryToScanInstanceScopeNow(loc, scope_name, end_time)

    def BuildInstanceScopeNoScanning(self, loc, scope_name, end_time):
        self.fCalls.append(('BuildInstanceScopeNoScanning', loc, scope_name, end_time))
        return super().BuildInstanceScopeNoScanning(loc, scope_name, end_time)


def is_sync_counting(coord):
    return isinstance(coord, SyncCountingCoordinator)


@pytest.fixture
def synchost(host_reset, monkeypatch):
    h = SyncHost().Install().Patch(monkeypatch)
    yield h
    h.Destroy()


@pytest.fixture(params=['class', 'counting-subclass'])
def sync_cls(request):
    return (scancoordinator.CScanCoordinator if request.param == 'class'
            else SyncCountingCoordinator)


@pytest.fixture
def synccoord(sync_cls, synchost):
    c = make_coord(sync_cls, synchost)
    yield c
    if not c._CDestroyable__fDestroyed:
        c.destroy()


# ---- the helper process's callback object --------------------------------------------------

def helper_callback_class(name='HelperCallbacks', record=True):
    """A new class of helper callback objects.  With `record`, the class keeps
    every class-wide connection made on it in `fConnects` as
    (signal, callback, owner)."""

    def __init__(self):
        destroyable.CDestroyable.__init__(self, kHelperSignals)

    namespace = {'__init__': __init__, 'fConnects': []}
    if record:
        def class_connect_while_alive(cls, signal, callback, owner):
            cls.fConnects.append((signal, callback, owner))
            real = destroyable.CDestroyable.__dict__['class_connect_while_alive']
            return real.__get__(None, cls)(signal, callback, owner)
        namespace['class_connect_while_alive'] = classmethod(class_connect_while_alive)
    return type(name, (destroyable.CDestroyable,), namespace)
