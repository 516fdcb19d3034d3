"""The cache manager: open buffers, analyses and the end-of-line-blind text cache.

Scanners read source through ``GetSourceForScan``: the open buffer's text when
the file is open, else the file's contents with line endings normalised.  The
latter are cached per file and modification time (the "EOL-blind" cache), which
``_ClearEOLBlindCacheAndScans`` empties.  A file that cannot be read as source
(gone, not a regular file, unreadable, not decodable in its encoding) gives
None, and the reason is kept in ``fReadProblems`` until the file reads well.
"""
from __future__ import annotations

from typing import Any

from ostrelbase import destroyable

from cache import textcache
from pysource import strutils

kVanished = 'vanished'
kNotAFile = 'not a regular file'
kUnreadable = 'unreadable'
kUndecodable = 'undecodable'


class CCacheManager(destroyable.CDestroyable):
    kSignals = ('buffer-opened', 'buffer-closed')

    def __init__(self) -> None:
        super().__init__(self.kSignals)
        self._fBuffers: dict[Any, textcache.CTextCache] = {}
        self._fAnalyses: dict[Any, Any] = {}
        self._fEOLBlind: dict[Any, tuple[float, str]] = {}
        # loc -> (kind, detail): why the file's source could not be read
        self.fReadProblems: dict[Any, tuple[str, str]] = {}

    # -- buffers -------------------------------------------------------------------

    def OpenBuffer(self, loc: Any) -> textcache.CTextCache:
        """The file's buffer, loaded from the file when not open yet."""
        buf = self._fBuffers.get(loc)
        if buf is None:
            buf = textcache.CTextCache.LoadFrom(loc)
            self._fBuffers[loc] = buf
            buf.connect_while_alive('text-modified', self._CB_TextModified, self)
            self.emit('buffer-opened', self, buf)
        return buf

    def CloseBuffer(self, loc: Any) -> None:
        buf = self._fBuffers.pop(loc, None)
        if buf is not None:
            self.emit('buffer-closed', self, buf)
            buf.destroy()

    def DoesCacheBufferExist(self, loc: Any, loaded_only: bool = True
                             ) -> textcache.CTextCache | None:
        """The open buffer of ``loc``, or None.  (Buffers are always loaded here, so
        ``loaded_only`` changes nothing.)"""
        return self._fBuffers.get(loc)

    def GetOpenBuffers(self) -> list[textcache.CTextCache]:
        return list(self._fBuffers.values())

    def _CB_TextModified(self, buf: textcache.CTextCache, *args: Any) -> None:
        ana = self._fAnalyses.get(buf.fLocation)
        if ana is not None:
            ana.NotifyModified()

    # -- analyses ------------------------------------------------------------------

    def GetAnalysis(self, loc: Any, create: bool) -> Any:
        """The analysis of a Python file; created only when ``create`` is true."""
        ana = self._fAnalyses.get(loc)
        if ana is None and create:
            from pysource import analysis, utils
            if not utils.IsPythonSource(loc):
                return None
            ana = analysis.CPySourceAnalysis(loc)
            self._fAnalyses[loc] = ana
        return ana

    # -- source for scanning -------------------------------------------------------

    def GetSourceForScan(self, loc: Any) -> tuple[str, float | None] | None:
        """(text, modification time) of the file, time None for an unsaved buffer;
        None when the file does not exist."""
        buf = self._fBuffers.get(loc)
        if buf is not None:
            return buf.GetText(), (None if buf.IsModified() else buf._GetLastKnownModTime())
        # The time is taken before the contents: a file that changes in between is
        # stored with the older time and so counts as changed next time.
        st = loc.GetStat()
        if not st.exists:
            return self._Problem(loc, kVanished, 'no longer exists')
        if st.is_dir or not st.is_file:
            return self._Problem(loc, kNotAFile, 'not a regular file')
        cached = self._fEOLBlind.get(loc)
        if cached is not None and cached[0] == st.mtime:
            return cached[1], st.mtime
        try:
            data = loc.ReadBytes()
        except FileNotFoundError:
            return self._Problem(loc, kVanished, 'vanished while being read')
        except OSError as exc:
            return self._Problem(loc, kUnreadable, exc.strerror or str(exc))
        try:
            text = strutils.DecodeSource(data, strict=True)
        except (UnicodeDecodeError, LookupError, SyntaxError) as exc:
            return self._Problem(loc, kUndecodable, strutils.DescribeDecodeError(exc))
        text = strutils.NormalizeEOLs(text)
        self.fReadProblems.pop(loc, None)
        self._fEOLBlind[loc] = (st.mtime, text)
        return text, st.mtime

    def _Problem(self, loc: Any, kind: str, detail: str) -> None:
        self.fReadProblems[loc] = (kind, detail)
        self._fEOLBlind.pop(loc, None)

    def _ClearEOLBlindCacheAndScans(self) -> None:
        """Forget the cached file texts (and so any scan state built on them)."""
        self._fEOLBlind.clear()

    def _destroy_impl(self) -> None:
        for loc in list(self._fBuffers):
            self.CloseBuffer(loc)
        for ana in self._fAnalyses.values():
            ana.destroy()
        self._fAnalyses.clear()
        self._fEOLBlind.clear()
