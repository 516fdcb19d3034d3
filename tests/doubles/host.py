"""Host-object doubles: the location data cache and the GUI manager.

They derive from the host's destroyable base class so that the code under test
can connect to them with `connect_while_alive` exactly as it does in the
application, and they emit through the real signal machinery.
"""
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
