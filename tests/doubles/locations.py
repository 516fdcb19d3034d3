"""Location doubles: value objects naming local or remote files.

Two locations are equal when they are of the same kind and have the same URL,
and hash accordingly, so a test may build the same location twice.  The hash
is a function of the URL only (no object identity), which keeps set and dict
iteration orders identical for every queue that sees the same operations.
"""


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
