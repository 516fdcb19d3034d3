"""Scripted stand-ins for the scan queue's collaborators (the benchmarks use them
too), and location value objects whose hash depends on the URL only, so that set
and dict iteration orders are the same for every queue that sees the same
operations."""
from types import SimpleNamespace

from ostrelbase import destroyable


class FakeLocationDataCache(destroyable.CDestroyable):
    """Answers `TreeBranchReady` from `fReady`, which the test controls."""

    def __init__(self, ready=()):
        destroyable.CDestroyable.__init__(
            self, ('now-tree-branch-ready', 'inspect-failed', 'cleared'))
        self.fReady = set(ready)
        self.fCalls = []

    def TreeBranchReady(self, loc, flag):
        self.fCalls.append(('TreeBranchReady', loc, flag))
        return loc in self.fReady

    def MakeReady(self, locs, data=None):
        """Marks locations ready and announces them as the host does."""
        locs = set(locs)
        self.fReady.update(locs)
        self.emit('now-tree-branch-ready', data, locs)

    def MakeUnready(self, locs):
        """Forgets that locations are ready, without telling anyone."""
        self.fReady.difference_update(locs)

    def AskedAbout(self):
        return [call[1] for call in self.fCalls if call[0] == 'TreeBranchReady']


class FakeGuiMgr(destroyable.CDestroyable):
    """Reports a scripted active document and set of visible documents."""

    def __init__(self, active=None, visible=()):
        destroyable.CDestroyable.__init__(self, ('active-document-changed',))
        self.fActive = active
        self.fVisible = list(visible)
        self.fCalls = []

    def GetActiveDocument(self):
        self.fCalls.append(('GetActiveDocument',))
        return self.fActive

    def GetDocuments(self, visible_only=False, include_help=True):
        self.fCalls.append(('GetDocuments', visible_only, include_help))
        return list(self.fVisible)


class OtherDocument:
    """A document that is not a source editor (e.g. a help page)."""

    fCache = SimpleNamespace(fLocation=None)


def make_source_editor(loc):
    """Returns the host's source editor for `loc`, with a minimal buffer."""
    from edit import editor
    return editor.CSourceEditor(SimpleNamespace(fLocation=loc))


class SignalRecorder:
    """Connects to signals of a destroyable and records (signal, args) per emission."""

    def __init__(self, obj, signals):
        self.fEmitted = []
        for signal in signals:
            obj.connect(signal, self._Recorder(signal))

    def _Recorder(self, signal):
        def record(*args):
            self.fEmitted.append((signal, args))
        return record

    def Names(self):
        return [signal for signal, _ in self.fEmitted]

    def Clear(self):
        del self.fEmitted[:]


class FakeLocation:
    """A file location; `kAsync` says whether its data arrives asynchronously."""

    __slots__ = ('_fHash', 'fUrl')
    kAsync = False

    def __init__(self, url):
        self.fUrl = url
        self._fHash = hash((type(self).__name__, url))

    def __hash__(self):
        return self._fHash

    def __eq__(self, other):
        if type(other) is not type(self):
            return NotImplemented
        return self.fUrl == other.fUrl

    def __repr__(self):
        return f'{type(self).__name__}({self.fUrl!r})'

    def GetParentDir(self):
        parent, _, _ = self.fUrl.rpartition('/')
        return type(self)(parent)

    def IsReady(self):
        return not self.kAsync


class LocalLocation(FakeLocation):
    __slots__ = ()

    def __init__(self, name):
        super().__init__(name if '://' in name else f'file:///src/{name}')


class AsyncLocation(FakeLocation):
    __slots__ = ()
    kAsync = True

    def __init__(self, name):
        super().__init__(name if '://' in name else f'ssh://build-host/src/{name}')


class AsyncInspectProbe:
    """Replacement for `location.IsAsyncInspectLocation` that answers from the
    location's kind and records every location it was asked about."""

    def __init__(self):
        self.fCalls = []

    def __call__(self, loc):
        self.fCalls.append(loc)
        return bool(getattr(loc, 'kAsync', False))
