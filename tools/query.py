"""The editor's path: what one scope of a file holds, asked for within a deadline.

    ./run query FILE [SCOPE] [--deadline-ms N] [--project DIR] [--db FILE]
                [--visible FILE]... [--no-follow-stdlib]

SCOPE is a dotted scope name (``Shape``, ``Shape.area``, ``f#2`` for the second
``def f``), ``Shape()`` for the instances of a class, or nothing for the
module's top level.

It goes the way the editor goes: FILE is reported as parseable (queued in the
background), opened in the GUI manager as the active document (with the
``--visible`` files as other visible documents), which makes the scan queue
promote their work (UpdateForVisibleDocuments); then the coordinator's
TryToScanNow is asked for SCOPE with a deadline, the instance-scope path for
``Class()``.  The names of the scope are printed with their kinds and what
they resolve to.  When the deadline passes first, it says so, runs the main
loop until the coordinator's idle scanning has finished the rest, and prints
again.

The project (default: FILE's directory) and its database are the ones
``./run scan`` uses, so a scanned project answers from what is stored.
"""
import argparse
import os
import sys
import time
from pathlib import Path

import hostapp
import scan
import scanreport
from guiutils import ostrelgtk
from ostrelbase import location
from rich import box
from rich.console import Console
from rich.table import Table

from pysource import inferencer, infodb, symbolinfo

kKindWords = {
    symbolinfo.kImportKind: 'import', symbolinfo.kFromImportKind: 'from-import',
    symbolinfo.kClassKind: 'class', symbolinfo.kFunctionKind: 'function',
    symbolinfo.kUnboundMethodKind: 'method', symbolinfo.kMethodKind: 'bound method',
    symbolinfo.kParamKind: 'parameter', symbolinfo.kLiteralKind: 'literal',
    symbolinfo.kPlainEquivKind: 'expression',
}
kPriorityWords = {0: 'basic modules', 1: 'interactive', 2: 'background'}


class CQueryError(Exception):
    """Bad input; the message is one line."""


def ParseArgs(argv: list[str]) -> argparse.Namespace:
    parser = argparse.ArgumentParser(
        prog='./run query', description="Show one scope of a file through the editor's "
        'immediate-scan path of the scan coordinator.')
    parser.add_argument('file')
    parser.add_argument('scope', nargs='?', default='',
                        help="scope name: 'Class', 'Class.method', 'Class()' for instances; "
                        "none for the module's top level")
    parser.add_argument('--deadline-ms', type=float, default=200.0,
                        help='time allowed for the immediate scan (default 200)')
    parser.add_argument('--project', help="project directory (default: FILE's directory)")
    parser.add_argument('--db', help='database (default: the one ./run scan uses for the project)')
    parser.add_argument('--visible', action='append', default=[], metavar='FILE',
                        help='another file shown in the editor (repeatable)')
    parser.add_argument('--no-follow-stdlib', action='store_true',
                        help='put only the project directory on the Python path')
    return parser.parse_args(argv)


def Kinds(value: bytes) -> str:
    words = []
    for part in symbolinfo.NonNestedSplit(value, symbolinfo.kEquivSeparator):
        word = kKindWords.get(symbolinfo.EquivKind(part), 'expression')
        if word not in words:
            words.append(word)
    return ', '.join(words)


class CQuery:
    def __init__(self, app: hostapp.CApplication, coord: object, loc: object, scope: str,
                 console: Console) -> None:
        self.fApp = app
        self.fCoord = coord
        self.fLoc = loc
        self.fScope = scope
        self.fConsole = console
        self.fRoot = app.fProjectDir.fPath
        self.fInstanceInfo = None

    def Short(self, text: str) -> str:
        """Resolutions name files by URL: show project files relative to it."""
        text = text.replace(location.kLocalScheme + self.fRoot.rstrip('/') + '/', '')
        return scanreport.DisplayPath(text.replace(location.kLocalScheme, ''))

    def QueuedPriority(self, loc: object) -> int | None:
        primary = self.fApp.fAnaMgr.fPrimaryScanName
        return self.fCoord._fScanQueue._FindScanPriority(loc, '*', primary)

    def OpenInEditor(self, visible: list) -> None:
        """Queue the files, then open them: the active document's and the visible
        documents' work moves to the interactive queue, the active one first."""
        opened = [self.fLoc, *visible]
        self.fCoord.AddParseablesToQueue(opened)
        before = [self.QueuedPriority(loc) for loc in opened]
        gui = self.fApp.fSingletons.fGuiMgr
        for loc in visible:
            gui.OpenDocument(loc, visible=True, activate=False)
        gui.OpenDocument(self.fLoc, visible=True, activate=True)
        for i, loc in enumerate(opened):
            after = self.QueuedPriority(loc)
            role = 'the active document' if i == 0 else 'a visible document'
            moved = (f'scan moved from priority {before[i]} ({kPriorityWords.get(before[i])}) '
                     f'to {after} ({kPriorityWords.get(after)})' if before[i] is not None
                     else 'nothing queued')
            self.fConsole.print(f'opened {self.Short(loc.fUrl)} as {role}: {moved}')

    def ScanNow(self, deadline_ms: float) -> bool:
        """TryToScanNow within the deadline; returns whether it finished in time."""
        started = time.time()
        end_time = started + deadline_ms / 1000.0
        result = self.fCoord.TryToScanNow(self.fLoc, self.fScope, None, end_time)
        elapsed = (time.time() - started) * 1000.0
        if isinstance(result, tuple) and result[0] is False:
            raise CQueryError(f'no such file: {self.Short(self.fLoc.fUrl)}')
        in_time = time.time() < end_time and not (isinstance(result, tuple) and result[0])
        if symbolinfo.IsInstanceScope(self.fScope):
            self.fInstanceInfo = result
            in_time = in_time and result is not None
        self.fConsole.print(f'TryToScanNow({self.fScope!r}) took {elapsed:.1f} ms of '
                            f'{deadline_ms:g} ms' + ('' if in_time else ': the deadline passed'))
        return in_time

    def Finish(self) -> None:
        """Let the coordinator's idle scanning do the rest."""
        started = time.perf_counter()
        ostrelgtk.run_until_idle(sys.maxsize)
        self.fConsole.print(f'the idle loop finished the rest in '
                            f'{(time.perf_counter() - started) * 1000:.0f} ms:')
        if symbolinfo.IsInstanceScope(self.fScope):
            # Only from what the information cache now holds.
            self.fInstanceInfo = self.fCoord.BuildInstanceScopeNoScanning(
                self.fLoc, self.fScope, 0.0)

    def ResolveInstanceName(self, name: str) -> str:
        """An instance scope has no derived scan: work out each name where it is
        defined, in the class or in the methods that assign ``self.name``."""
        cache = self.fApp.fAnaMgr.fInfoCache
        class_scope = symbolinfo.GetClassForInstanceName(self.fScope)
        class_info = cache.GetScopeInfo(self.fLoc, class_scope)
        if class_info is None:
            return 'unresolved'
        found: list[str] = []
        if name in class_info.type_equivs:
            found.append(self.fEngine.DescribeValue(self.fLoc, class_scope,
                                                    class_info.type_equivs[name], 0, set()))
        for value in class_info.type_equivs.values():
            method = symbolinfo.FindDefInfo(value, symbolinfo.kUnboundMethodPrefix)
            minfo = method and cache.GetScopeInfo(self.fLoc, method.scope_name)
            if not minfo or not method.args:
                continue
            assigned = minfo.type_equivs.get(f'{method.args[0]}.{name}')
            if assigned:
                desc = self.fEngine.DescribeValue(self.fLoc, method.scope_name, assigned, 0,
                                                  set())
                if desc not in found:
                    found.append(desc)
        return ' | '.join(found) or 'unresolved'

    def Show(self) -> bool:
        """Print the scope's names; False when there is no such scope."""
        cache = self.fApp.fAnaMgr.fInfoCache
        if symbolinfo.IsInstanceScope(self.fScope):
            info = self.fInstanceInfo
            derived = None
        else:
            info = cache.GetScopeInfo(self.fLoc, self.fScope)
            derived = cache.GetDerivedInfo(self.fLoc, self.fScope)
        where = f'{self.fScope or "(module)"} in {self.Short(self.fLoc.fUrl)}'
        if info is None:
            self.fConsole.print(f'nothing known yet about {where}')
            return True
        if info.does_not_exist:
            self.fConsole.print(f'no scope {where}')
            return False
        self.fEngine = inferencer.CInferencer(self.fApp.fAnaMgr)
        table = Table(title=where + (' (incomplete: syntax errors)' if info.incomplete else ''),
                      box=box.SIMPLE_HEAD, title_justify='left')
        table.add_column('name', style='bold')
        table.add_column('kind')
        table.add_column('resolves to')
        for name, value in info.type_equivs.items():
            if derived is not None and name in derived:
                resolved = derived[name]
            elif symbolinfo.IsInstanceScope(self.fScope):
                resolved = self.ResolveInstanceName(name)
            else:
                resolved = self.fEngine.DescribeValue(self.fLoc, self.fScope, value, 0, set())
            table.add_row(name, Kinds(value), self.Short(resolved))
        self.fConsole.print(table)
        return True


def main(argv: list[str]) -> int:
    args = ParseArgs(argv)
    console = Console(highlight=False)
    if not console.is_terminal and 'COLUMNS' not in os.environ:
        console.width = 120
    try:
        path = Path(args.file).expanduser().absolute()
        if not path.is_file():
            raise CQueryError(f'not a file: {args.file}' if path.exists()
                              else f'no such file: {args.file}')
        path = Path(os.path.realpath(path))
        root = scan.CheckDirectory(args.project) if args.project else path.parent
        db = os.path.abspath(args.db) if args.db else scan.DefaultDatabase(root)
        scan.CheckDatabasePath(db)
        visible = []
        for name in args.visible:
            if not os.path.isfile(name):
                raise CQueryError(f'no such file: {name}')
            visible.append(location.CLocalFileLocation(os.path.realpath(name)))
        app = hostapp.CreateApplication(
            str(root), db_path=db, python_path=[str(root)] if args.no_follow_stdlib else None,
            load_database=False)
        try:
            app.fAnaMgr.fInfoCache.LoadFromDatabase()
        except infodb.CDatabaseError as exc:
            app.Shutdown()
            raise CQueryError(str(exc)) from None
    except (CQueryError, scan.CUsageError) as exc:
        print(f'query: {exc}', file=sys.stderr)
        return 2
    try:
        coord = hostapp.CreateScanCoordinator(app)
        query = CQuery(app, coord, location.CLocalFileLocation(str(path)), args.scope, console)
        query.OpenInEditor(visible)
        try:
            in_time = query.ScanNow(args.deadline_ms)
        except CQueryError as exc:
            print(f'query: {exc}', file=sys.stderr)
            return 2
        if in_time:
            found = query.Show()
        else:
            query.Show()
            query.Finish()
            found = query.Show()
    finally:
        app.Shutdown()
    return 0 if found else 1


if __name__ == '__main__':
    sys.exit(main(sys.argv[1:]))
