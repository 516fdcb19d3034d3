"""Scanners: build scope information from Python source, in time slices.

Design note
-----------
A scanner does one scan of one file or one scope.  ``Scan(end_time)`` works until
about ``end_time`` and returns its state; an unfinished scan keeps its progress
for the next call.  Each call makes progress (at least one unit of work) even when
called past its deadline, so repeated calls always finish.

Primary scanners read the source (an open buffer's text, else the file), parse it
with ``ast`` and record, per scope, what each name is equivalent to (the format of
``symbolinfo``).  The parse tolerates syntax errors: the offending lines are
replaced by ``pass`` until the source parses, and the scopes holding replaced
lines are reported incomplete (added to the caller's ``incomplete_scope_set``).
A whole-file primary scan processes one scope per unit and stores all of the
file's scopes at the end; a single-scope scan stores only when asked
(``SaveToInfoCache``).

Secondary scanners derive information from what the primary scan stored: what
each name resolves to (``inferencer``).  They store their results themselves.

Remote files: a scanner whose location's contents are not at hand asks for them
(inspecting the location first if needed), returns ``kWaitingForData`` and, when
the data arrives (or the agent gives up), emits "scan-state-changed" with itself
as argument.  A scan whose data could not be had is abandoned and the file is
listed among the cache manager's read problems.
"""
from __future__ import annotations

import ast
import collections
import time
from collections.abc import Iterable, Iterator
from typing import Any

import singleton
from ostrelbase import destroyable, location

from pysource import logicalline, scopeinfo, symbolinfo
from pysource.symbolinfo import JoinScopeName

kReadyToScan = 0
kWaitingForData = 1
kFinishedScanning = 2
kTimedOut = 3
kScanAbandoned = 4

kStateNames = {kReadyToScan: 'ready', kWaitingForData: 'waiting-for-data',
               kFinishedScanning: 'finished', kTimedOut: 'timed-out',
               kScanAbandoned: 'abandoned'}

kMaxParseRepairs = 50
kMaxPlainEquivLen = 200
kUnsavedMTime = -2.0

# -- parsing -----------------------------------------------------------------------


def ParseTolerant(text: str) -> tuple[ast.Module, set[int], bool]:
    """Parse ``text``; lines with syntax errors are replaced by ``pass`` until it
    parses.  Returns (tree, replaced line numbers, whether parsing failed outright).
    The line count never changes, so positions in the tree match ``text``.  Lines
    holding a NUL character (which the parser refuses outright) are replaced
    first."""
    lines = text.split('\n')
    patched: set[int] = set()
    if '\0' in text:
        for i, line in enumerate(lines):
            if '\0' in line:
                indent = line[:len(line) - len(line.lstrip(' \t'))]
                lines[i] = indent + 'pass'
                patched.add(i + 1)
    for _attempt in range(kMaxParseRepairs + 1):
        try:
            return ast.parse('\n'.join(lines)), patched, False
        except SyntaxError as exc:
            lineno = _LineToPatch(lines, exc.lineno, patched)
            if lineno is None:
                break
            line = lines[lineno - 1]
            indent = line[:len(line) - len(line.lstrip(' \t'))]
            lines[lineno - 1] = indent + 'pass'
            patched.add(lineno)
        except (ValueError, RecursionError, MemoryError):
            break
    return ast.Module(body=[], type_ignores=[]), patched, True


def _LineToPatch(lines: list[str], lineno: int | None, patched: set[int]) -> int | None:
    """The error line, or the nearest earlier line with code not yet replaced."""
    n = min(max(lineno or len(lines), 1), len(lines))
    while n >= 1:
        if n not in patched and lines[n - 1].strip() and \
                not lines[n - 1].lstrip().startswith('#'):
            return n
        n -= 1
    return None


class _CSegments:
    """Source text of nodes, with the lines split once."""

    def __init__(self, text: str) -> None:
        self._fLines = text.split('\n')

    def Get(self, node: ast.AST) -> str:
        try:
            l1, c1 = node.lineno - 1, node.col_offset
            l2, c2 = node.end_lineno - 1, node.end_col_offset
        except AttributeError:
            return ''
        if l1 < 0 or l2 >= len(self._fLines) or l2 < l1:
            return ''
        # Offsets are in UTF-8 bytes.
        if l1 == l2:
            line = self._fLines[l1].encode('utf-8', 'surrogateescape')
            return line[c1:c2].decode('utf-8', 'replace')
        first = self._fLines[l1].encode('utf-8', 'surrogateescape')[c1:]
        last = self._fLines[l2].encode('utf-8', 'surrogateescape')[:c2]
        middle = [s.encode('utf-8', 'surrogateescape') for s in self._fLines[l1 + 1:l2]]
        return b'\n'.join([first, *middle, last]).decode('utf-8', 'replace')


class CScopeDef:
    """The definition opening a scope: ``fType`` is ``logicalline.kClassDef`` or
    ``logicalline.kFunctionDef``."""

    __slots__ = ('fEndLineno', 'fLineno', 'fScopeName', 'fType')

    def __init__(self, def_type: str, scope_name: str, lineno: int, end_lineno: int) -> None:
        self.fType = def_type
        self.fScopeName = scope_name
        self.fLineno = lineno
        self.fEndLineno = end_lineno

    def __repr__(self) -> str:
        return f'<CScopeDef {self.fType} {self.fScopeName!r} lines {self.fLineno}-{self.fEndLineno}>'


class _CScopeRecord:
    """One scope found in a parse: its node, name, parent and child definitions."""

    __slots__ = ('fChildren', 'fDefType', 'fIncomplete', 'fName', 'fNode', 'fParent')

    def __init__(self, name: str, node: ast.AST, def_type: str,
                 parent: _CScopeRecord | None) -> None:
        self.fName = name
        self.fNode = node
        self.fDefType = def_type
        self.fParent = parent
        self.fChildren: list[tuple[str, str, ast.AST]] = []  # (bound name, scope, node)
        self.fIncomplete = False

    def LineRange(self) -> tuple[int, int]:
        if self.fDefType == logicalline.kModuleDef:
            return 1, 1 << 30
        first = min([self.fNode.lineno] + [d.lineno for d in self.fNode.decorator_list])
        return first, self.fNode.end_lineno

    def InClass(self) -> bool:
        return self.fParent is not None and self.fParent.fDefType == logicalline.kClassDef

    def GetScopeDef(self) -> CScopeDef | None:
        if self.fDefType == logicalline.kModuleDef:
            return None
        return CScopeDef(self.fDefType, self.fName, *self.LineRange())

    def DefPrefix(self) -> bytes:
        if self.fDefType == logicalline.kClassDef:
            return symbolinfo.kClassPrefix
        return symbolinfo.kUnboundMethodPrefix if self.InClass() else symbolinfo.kFunctionPrefix

    def ArgNames(self) -> list[str]:
        if self.fDefType != logicalline.kFunctionDef:
            return []
        a = self.fNode.args
        names = [x.arg for x in (*a.posonlyargs, *a.args)]
        if a.vararg:
            names.append('*' + a.vararg.arg)
        names.extend(x.arg for x in a.kwonlyargs)
        if a.kwarg:
            names.append('**' + a.kwarg.arg)
        return names

    def PackedDefInfo(self) -> bytes:
        if self.fDefType == logicalline.kModuleDef:
            return b''
        first, last = self.LineRange()
        return symbolinfo.PackDefInfoStr(self.DefPrefix(), self.fName, first, last,
                                         self.ArgNames())


_kBlockFields = ('body', 'orelse', 'finalbody')


def _ScopeStatements(body: Iterable[ast.stmt]) -> Iterator[ast.stmt]:
    """The statements of one scope, including those in nested blocks (if, for, try,
    with, match) but not those inside nested class or def bodies."""
    stack = list(reversed(list(body)))
    while stack:
        stmt = stack.pop()
        yield stmt
        if isinstance(stmt, (ast.FunctionDef, ast.AsyncFunctionDef, ast.ClassDef)):
            continue
        nested: list[ast.stmt] = []
        for field in _kBlockFields:
            nested.extend(getattr(stmt, field, None) or ())
        for handler in getattr(stmt, 'handlers', None) or ():
            nested.extend(handler.body)
        for case in getattr(stmt, 'cases', None) or ():
            nested.extend(case.body)
        stack.extend(reversed(nested))


def CollectScopes(tree: ast.Module, patched_lines: Iterable[int] = (),
                  parse_failed: bool = False) -> list[_CScopeRecord]:
    """Every scope of a parse, the module first, parents before children.

    A name defined twice in one scope gets the redefinition suffix on its second
    definition (``f``, ``f#2``).  Scopes holding replaced lines are marked incomplete.
    """
    module = _CScopeRecord(symbolinfo.kModuleScope, tree, logicalline.kModuleDef, None)
    records = [module]
    pending = collections.deque([module])
    while pending:
        rec = pending.popleft()
        counts: collections.Counter[str] = collections.Counter()
        body = rec.fNode.body
        for stmt in _ScopeStatements(body):
            if isinstance(stmt, (ast.FunctionDef, ast.AsyncFunctionDef, ast.ClassDef)):
                counts[stmt.name] += 1
                leaf = symbolinfo.AddRedefinitionSuffix(stmt.name, counts[stmt.name])
                def_type = (logicalline.kClassDef if isinstance(stmt, ast.ClassDef)
                            else logicalline.kFunctionDef)
                child = _CScopeRecord(JoinScopeName(rec.fName, leaf), stmt, def_type, rec)
                rec.fChildren.append((stmt.name, child.fName, stmt))
                records.append(child)
                pending.append(child)
    if parse_failed:
        module.fIncomplete = True
    for lineno in patched_lines:
        best = module
        for rec in records[1:]:
            first, last = rec.LineRange()
            if first <= lineno <= last and first >= best.LineRange()[0]:
                best = rec
        best.fIncomplete = True
    return records


def _ValueEquiv(node: ast.expr, seg: _CSegments) -> bytes:
    if isinstance(node, ast.Constant):
        return symbolinfo.MakeLiteralEquiv(type(node.value).__name__)
    literal_types = {ast.List: 'list', ast.ListComp: 'list', ast.Dict: 'dict',
                     ast.DictComp: 'dict', ast.Set: 'set', ast.SetComp: 'set',
                     ast.Tuple: 'tuple', ast.JoinedStr: 'str', ast.Lambda: 'function',
                     ast.GeneratorExp: 'generator'}
    for node_type, name in literal_types.items():
        if isinstance(node, node_type):
            return symbolinfo.MakeLiteralEquiv(name)
    return _Plain(seg.Get(node))


def _Plain(text: str) -> bytes:
    if len(text) > kMaxPlainEquivLen:
        text = text[:kMaxPlainEquivLen]
    return symbolinfo.MakePlainEquiv(text) if text.strip() else b''


def BuildScopeInfo(rec: _CScopeRecord, loc: Any, scan_name: str, mtime: float,
                   seg: _CSegments) -> scopeinfo.CScopeInfo:
    """The ``CScopeInfo`` of one scope record."""
    equivs: dict[str, list[bytes]] = collections.defaultdict(list)

    def add(name: str, eq: bytes) -> None:
        if eq:
            equivs[name].append(eq)

    node = rec.fNode
    self_name = None
    if rec.fDefType == logicalline.kFunctionDef:
        a = node.args
        positional = [*a.posonlyargs, *a.args]
        defaults = [None] * (len(positional) - len(a.defaults)) + list(a.defaults)
        for i, (arg, default) in enumerate(zip(positional, defaults)):
            add(arg.arg, symbolinfo.MakeParamEquiv(i, seg.Get(default) if default else None))
        for j, (arg, default) in enumerate(zip(a.kwonlyargs, a.kw_defaults)):
            add(arg.arg, symbolinfo.MakeParamEquiv(len(positional) + j,
                                                   seg.Get(default) if default else None))
        if a.vararg:
            add(a.vararg.arg, symbolinfo.MakeLiteralEquiv('tuple'))
        if a.kwarg:
            add(a.kwarg.arg, symbolinfo.MakeLiteralEquiv('dict'))
        decorators = {seg.Get(d) for d in node.decorator_list}
        if rec.InClass() and positional and not decorators & {'staticmethod', 'classmethod'}:
            self_name = positional[0].arg

    def targets(target: ast.expr, value_eq: bytes, value_text: str) -> None:
        if isinstance(target, ast.Name):
            add(target.id, value_eq)
        elif isinstance(target, (ast.Tuple, ast.List)):
            for i, elt in enumerate(target.elts):
                if isinstance(elt, ast.Starred):
                    elt = elt.value
                targets(elt, _Plain(f'{value_text}[{i}]') if value_text else b'', '')
        elif (isinstance(target, ast.Attribute) and self_name is not None
              and isinstance(target.value, ast.Name) and target.value.id == self_name):
            add(f'{self_name}.{target.attr}', value_eq)

    children = {id(child_node): scope for _name, scope, child_node in rec.fChildren}
    for stmt in _ScopeStatements(node.body):
        if isinstance(stmt, ast.Import):
            for alias in stmt.names:
                bound = alias.asname or alias.name.partition('.')[0]
                add(bound, symbolinfo.MakeImportEquiv(alias.name))
        elif isinstance(stmt, ast.ImportFrom):
            module = '.' * stmt.level + (stmt.module or '')
            for alias in stmt.names:
                add(alias.asname or alias.name,
                    symbolinfo.MakeFromImportEquiv(module, alias.name))
        elif isinstance(stmt, (ast.FunctionDef, ast.AsyncFunctionDef, ast.ClassDef)):
            child_name = children.get(id(stmt))
            if child_name is not None:
                child = _CScopeRecord(child_name, stmt,
                                      logicalline.kClassDef if isinstance(stmt, ast.ClassDef)
                                      else logicalline.kFunctionDef, rec)
                add(stmt.name, child.PackedDefInfo())
        elif isinstance(stmt, ast.Assign):
            value_eq, value_text = _ValueEquiv(stmt.value, seg), seg.Get(stmt.value)
            for target in stmt.targets:
                targets(target, value_eq, value_text)
        elif isinstance(stmt, ast.AnnAssign):
            eq = (_ValueEquiv(stmt.value, seg) if stmt.value is not None
                  else _Plain(seg.Get(stmt.annotation)))
            targets(stmt.target, eq, '')
        elif isinstance(stmt, (ast.For, ast.AsyncFor)):
            targets(stmt.target, _Plain(f'next(iter({seg.Get(stmt.iter)}))'), '')
        elif isinstance(stmt, (ast.With, ast.AsyncWith)):
            for item in stmt.items:
                if item.optional_vars is not None:
                    targets(item.optional_vars,
                            _Plain(f'{seg.Get(item.context_expr)}.__enter__()'), '')
        if isinstance(stmt, ast.Try) or type(stmt).__name__ == 'TryStar':
            for handler in stmt.handlers:
                if handler.name and handler.type is not None:
                    add(handler.name, _Plain(seg.Get(handler.type)))
    type_equivs = {name: symbolinfo.JoinEquivs(values) for name, values in equivs.items()}
    key = scopeinfo.CScopeInfoKey(loc, rec.fName, scan_name, loc, rec.fName)
    return scopeinfo.CScopeInfo(key, rec.PackedDefInfo(), mtime, rec.fIncomplete, False,
                                type_equivs)


def CreateClassInstInfo(class_info: scopeinfo.CScopeInfo,
                        method_infos: Iterable[scopeinfo.CScopeInfo],
                        scan_name: str) -> scopeinfo.CScopeInfo:
    """The information of a class's instance scope: the class's names with its
    unbound methods bound, plus the attributes its methods assign through their
    first parameter (``self.x = ...``)."""
    loc = class_info.key.loc
    class_scope = class_info.key.scope_name
    inst_name = symbolinfo.GetInstanceNameForClass(class_scope)
    equivs: dict[str, bytes] = {}
    for name, value in class_info.type_equivs.items():
        parts = []
        for part in symbolinfo.NonNestedSplit(value, symbolinfo.kEquivSeparator):
            if part.startswith(symbolinfo.kUnboundMethodPrefix):
                part = symbolinfo.kMethodPrefix + part[symbolinfo.kPrefixLen:]
            parts.append(part)
        equivs[name] = symbolinfo.JoinEquivs(parts)
    incomplete = class_info.incomplete
    for minfo in method_infos:
        incomplete = incomplete or minfo.incomplete
        definfo = minfo.GetDefInfo()
        if definfo is None or not definfo.args:
            continue
        prefix = definfo.args[0] + '.'
        for name, value in minfo.type_equivs.items():
            if name.startswith(prefix):
                attr = name[len(prefix):]
                equivs[attr] = symbolinfo.JoinEquivs([equivs.get(attr, b''), value])
    key = scopeinfo.CScopeInfoKey(loc, inst_name, scan_name, loc, class_scope)
    return scopeinfo.CScopeInfo(key, class_info.def_info, class_info.disk_mtime, incomplete,
                                False, equivs)


# -- scanners ------------------------------------------------------------------------


def _NoLog(*_args: Any) -> None:
    return None


def _OutOfTime(end_time: float) -> bool:
    return time.time() >= end_time


class CScanner(destroyable.CDestroyable):
    """Base class of scanners.

    Subclasses implement ``_Step(end_time)``, called by ``Scan`` while the scan is
    not waiting, finished or abandoned.
    """

    def __init__(self, loc: Any, scope_name: str, scan_name: str, log: Any = None,
                 ana_mgr: Any = None) -> None:
        super().__init__(('scan-state-changed',))
        self.fLocation = loc
        self.fScopeName = scope_name
        self.fScanName = scan_name
        self.fLog = log if log is not None else _NoLog
        self.fAnaMgr = ana_mgr if ana_mgr is not None else singleton.GetSingletons().fAnalysisMgr
        self.fState = kReadyToScan
        self.fFileDoesntExist = False
        self.fInfo: scopeinfo.CScopeInfo | None = None
        self.fScopeDef: CScopeDef | None = None
        self.fContainingClassDef: CScopeDef | None = None
        self.fStepCount = 0
        self._fDestroyed = False
        self._fWaitAborted = False

    def __repr__(self) -> str:
        return (f'<{type(self).__name__} {self.fScopeName!r} of {self.fLocation!r} '
                f'({kStateNames.get(self.fState, self.fState)})>')

    @property
    def fInfoCache(self) -> scopeinfo.CInfoCache:
        return self.fAnaMgr.fInfoCache

    def Scan(self, end_time: float) -> int:
        """Work until about ``end_time``; returns the scan state."""
        if self._fDestroyed:
            raise RuntimeError('scanner used after destroy()')
        if self.fState in (kFinishedScanning, kScanAbandoned, kWaitingForData):
            return self.fState
        if self._fWaitAborted:
            self.fState = kScanAbandoned
            return self.fState
        self.fStepCount += 1
        self.fState = self._Step(end_time)
        return self.fState

    def _Step(self, end_time: float) -> int:
        raise NotImplementedError

    def FilterNeedsScan(self, triples: Iterable[tuple[Any, str, str]]
                        ) -> list[tuple[Any, str, str]]:
        """The triples this scanner does not already cover while it runs."""
        return [t for t in triples if not self._Covers(t)]

    def _Covers(self, triple: tuple[Any, str, str]) -> bool:
        loc, scope_name, scan_name = triple
        return (loc == self.fLocation and scan_name == self.fScanName
                and self.fScopeName in (symbolinfo.kWildcardScope, scope_name))

    def SaveToInfoCache(self, notify: bool = True) -> bool:
        """Store the results; returns whether the stored information changed."""
        return False

    def _destroy_impl(self) -> None:
        self._fDestroyed = True
        self.fInfo = None

    # -- data of remote files ----------------------------------------------------------

    def _NeedsData(self) -> bool:
        """Whether the location's data must first arrive; starts waiting for it."""
        loc = self.fLocation
        if not location.IsAsyncInspectLocation(loc) or location.HasData(loc):
            return False
        if loc.IsReady() and not loc.GetStat().is_file:
            return False  # nothing to fetch; reading it reports why
        if singleton.GetSingletons().fCacheMgr.DoesCacheBufferExist(loc, True) is not None:
            return False  # scanned from its open buffer
        location._WaitForData(loc, self._CB_DataArrived)
        if location.HasData(loc):  # answered at once
            return False
        self.fState = kWaitingForData
        return True

    def _CB_DataArrived(self, abort: bool) -> None:
        if self._fDestroyed or self.fState != kWaitingForData:
            return
        if abort:
            problems = singleton.GetSingletons().fCacheMgr.fReadProblems
            problems[self.fLocation] = ('unreadable', 'remote data could not be had')
        self._fWaitAborted = bool(abort)
        self.fState = kScanAbandoned if abort else kReadyToScan
        self.emit('scan-state-changed', self)

    def _ReadSource(self) -> tuple[str, float | None] | None:
        """(text, modification time or None for an unsaved buffer), or None when the
        file does not exist."""
        return singleton.GetSingletons().fCacheMgr.GetSourceForScan(self.fLocation)

    def _Parse(self, text: str, mtime: float | None) -> scopeinfo.CParsedSource:
        return self.fInfoCache.GetParsedSource(self.fLocation, text,
                                               kUnsavedMTime if mtime is None else mtime,
                                               ParseTolerant)


class _CPrimaryScanner(CScanner):
    """Shared set-up of the primary scanners."""

    def __init__(self, loc: Any, scope_name: str, scan_name: str,
                 incomplete_scope_set: set[str] | None, log: Any, ana_mgr: Any) -> None:
        super().__init__(loc, scope_name, scan_name, log, ana_mgr)
        self.fIncompleteScopes = incomplete_scope_set if incomplete_scope_set is not None \
            else set()
        self.fMTime: float | None = None
        self._fRecords: collections.deque[_CScopeRecord] | None = None
        self._fSegments: _CSegments | None = None

    def _Prepare(self) -> int | None:
        """Read and parse; returns a final or waiting state when it cannot go on."""
        if self._NeedsData():
            return kWaitingForData
        source = self._ReadSource()
        if source is None:
            self.fFileDoesntExist = True
            return kScanAbandoned
        text, self.fMTime = source
        parsed = self._Parse(text, self.fMTime)
        self._fSegments = _CSegments(text)
        self._fRecords = collections.deque(
            CollectScopes(parsed.tree, parsed.patched_lines, parsed.parse_failed))
        return None

    def _DiskMTime(self) -> float:
        return kUnsavedMTime if self.fMTime is None else self.fMTime

    def _NoteCompleteness(self, info: scopeinfo.CScopeInfo) -> None:
        if info.incomplete:
            self.fIncompleteScopes.add(info.key.scope_name)
        else:
            self.fIncompleteScopes.discard(info.key.scope_name)


class CWholeFilePrimaryScanner(_CPrimaryScanner):
    """Builds the information of every scope of a file and stores it when done."""

    def __init__(self, loc: Any, scan_name: str, incomplete_scope_set: set[str] | None = None,
                 log: Any = None, ana_mgr: Any = None) -> None:
        super().__init__(loc, symbolinfo.kWildcardScope, scan_name, incomplete_scope_set,
                         log, ana_mgr)
        self._fInfos: dict[str, scopeinfo.CScopeInfo] = {}
        self.fChangedScopes: set[str] = set()

    def _Step(self, end_time: float) -> int:
        if self._fRecords is None:
            state = self._Prepare()
            if state is not None:
                if self.fFileDoesntExist:
                    self.fInfoCache.ForgetFile(self.fLocation)
                    self.fIncompleteScopes.clear()
                return state
        records = self._fRecords
        assert records is not None and self._fSegments is not None
        while records:
            rec = records.popleft()
            info = BuildScopeInfo(rec, self.fLocation, self.fScanName, self._DiskMTime(),
                                  self._fSegments)
            self._fInfos[rec.fName] = info
            if records and _OutOfTime(end_time):
                return kTimedOut
        self.fChangedScopes = self.fInfoCache.ReplaceFileInfos(
            self.fLocation, self._fInfos, self.fScanName, self.fMTime)
        self.fIncompleteScopes.clear()
        self.fIncompleteScopes.update(name for name, info in self._fInfos.items()
                                      if info.incomplete)
        self.fInfo = self._fInfos.get(symbolinfo.kModuleScope)
        return kFinishedScanning

    def GetScopeInfos(self) -> dict[str, scopeinfo.CScopeInfo]:
        """The scopes built so far (all of them once finished)."""
        return dict(self._fInfos)


class CSingleScopePrimaryScanner(_CPrimaryScanner):
    """Builds the information of one scope; ``SaveToInfoCache`` stores it."""

    def __init__(self, loc: Any, scope_name: str, incomplete_scope_set: set[str] | None = None,
                 log: Any = None, ana_mgr: Any = None) -> None:
        ana_mgr = ana_mgr if ana_mgr is not None else singleton.GetSingletons().fAnalysisMgr
        super().__init__(loc, scope_name, ana_mgr.fPrimaryScanName, incomplete_scope_set,
                         log, ana_mgr)

    def _Step(self, end_time: float) -> int:
        # Two units of work: reading and parsing, then building the scope's
        # information; a deadline that passes in between ends the first call.
        if self._fRecords is None:
            state = self._Prepare()
            if state is not None:
                return state
            if _OutOfTime(end_time):
                return kTimedOut
        assert self._fRecords is not None and self._fSegments is not None
        by_name = {rec.fName: rec for rec in self._fRecords}
        rec = by_name.get(self.fScopeName)
        if rec is None:
            key = scopeinfo.CScopeInfoKey(self.fLocation, self.fScopeName, self.fScanName,
                                          self.fLocation, self.fScopeName)
            self.fInfo = scopeinfo.CScopeInfo(key, b'', self._DiskMTime(), False, True)
            self.fIncompleteScopes.discard(self.fScopeName)
            return kFinishedScanning
        self.fInfo = BuildScopeInfo(rec, self.fLocation, self.fScanName, self._DiskMTime(),
                                    self._fSegments)
        self.fScopeDef = rec.GetScopeDef()
        if rec.InClass():
            assert rec.fParent is not None
            self.fContainingClassDef = rec.fParent.GetScopeDef()
        self._NoteCompleteness(self.fInfo)
        return kFinishedScanning

    def SaveToInfoCache(self, notify: bool = True) -> bool:
        """Store the scope's information.  With ``notify`` a change is reported as
        needing a derived rescan; returns whether the stored information changed."""
        if self.fInfo is None:
            if self.fFileDoesntExist:
                return self.fInfoCache.RemoveScopeInfo(self.fLocation, self.fScopeName)
            return False
        return self.fInfoCache.StoreScopeInfo(self.fInfo, notify)


class CWholeFileSecondaryScanner(CScanner):
    """Derives the information of every scope of a file that the primary scan stored."""

    def __init__(self, loc: Any, scan_name: str, log: Any = None, ana_mgr: Any = None) -> None:
        super().__init__(loc, symbolinfo.kWildcardScope, scan_name, log, ana_mgr)
        self._fPending: collections.deque[scopeinfo.CScopeInfo] | None = None
        self.fDerivedScopeCount = 0

    def _Step(self, end_time: float) -> int:
        from pysource import inferencer
        if self._fPending is None:
            self.fInfoCache.ResetDependencies(self.fLocation)
            infos = self.fInfoCache.GetScopeInfos(self.fLocation)
            self._fPending = collections.deque(infos[name] for name in sorted(infos))
        engine = inferencer.CInferencer(self.fAnaMgr)
        while self._fPending:
            info = self._fPending.popleft()
            if not info.does_not_exist:
                derived, deps = engine.DeriveScope(info)
                self.fInfoCache.SetDerivedInfo(self.fLocation, info.key.scope_name, derived,
                                               deps)
                self.fDerivedScopeCount += 1
            if self._fPending and _OutOfTime(end_time):
                return kTimedOut
        primary_time = self.fInfoCache.GetScanDoneTime(self.fLocation,
                                                       self.fAnaMgr.fPrimaryScanName)
        self.fInfoCache.RecordScanDone(self.fLocation, self.fScanName, primary_time)
        return kFinishedScanning


class CSingleScopeSecondaryScanner(CScanner):
    """Derives the information of one scope from its primary information."""

    def __init__(self, scope_info: scopeinfo.CScopeInfo, log: Any = None, ctx: Any = None,
                 ana_mgr: Any = None) -> None:
        ana_mgr = ana_mgr if ana_mgr is not None else singleton.GetSingletons().fAnalysisMgr
        super().__init__(scope_info.key.loc, scope_info.key.scope_name,
                         ana_mgr.fDerivedScanName, log, ana_mgr)
        self.fScopeInfo = scope_info
        self.fContext = ctx
        self.fDerived: dict[str, str] | None = None

    def _Step(self, end_time: float) -> int:
        from pysource import inferencer
        if self.fScopeInfo.does_not_exist:
            return kScanAbandoned
        derived, deps = inferencer.CInferencer(self.fAnaMgr).DeriveScope(self.fScopeInfo)
        self.fDerived = derived
        self.fInfoCache.SetDerivedInfo(self.fLocation, self.fScopeName, derived, deps)
        return kFinishedScanning
