"""Assembly of a working application around a project directory.

``CreateApplication(project_dir)`` builds the application singletons (preference,
cache, savable, file attribute and GUI managers) and the analysis manager of
the project, and returns a ``CApplication`` that holds them.  The main loop is
``guiutils.ostrelgtk``; run it with ``app.RunUntilIdle()`` or ``ostrelgtk.run()``.

The scan coordinator is attached by ``CreateScanCoordinator(app)``, kept apart so
that an application can be built (and tested) without the compiled module.

``CHostTiming`` measures where the time goes (``ostrelutils.timeaccount``): it
times the entry points of the collaborators that the coordinator calls, and the
coordinator's own callbacks run by the main loop, so that the coordinator's
self time can be told apart from the scanners', the information cache's and the
other host services'.
"""
from __future__ import annotations

import errno
import os
import stat
from collections.abc import Iterable
from typing import Any

import singleton
from cache import cachemgr, fileattribs, prefmgr, savable
from edit import editor
from guiutils import ostrelgtk
from ostrelbase import location
from ostrelutils import timeaccount

from pysource import analysis, analysismgr, inferenceengine, scopeinfo, scopescanner, utils

kDefaultIdlePriority = ostrelgtk.PRIORITY_DEFAULT_IDLE


class CApplication:
    """A running application: the singletons plus the project's analysis manager."""

    def __init__(self, project_dir: str, ana_mgr: analysismgr.CAnalysisManager) -> None:
        self.fProjectDir = location.CLocalFileLocation(project_dir)
        self.fSingletons = singleton.GetSingletons()
        self.fAnaMgr = ana_mgr
        self.fCoordinator: Any = None
        self.fSkippedEntries: list[tuple[str, str]] = []
        self.fRemote: Any = None  # remoteproject.CRemoteProject when files are remote
        self.fHelper: Any = None  # helperproc.CHelperProcessSupport when a helper runs

    def ProjectFiles(self, exclude: Iterable[str] = ()) -> list[location.CLocation]:
        """The project's files (recursively, hidden directories, ``__pycache__`` and
        names in ``exclude`` skipped), in directory order, each sorted.  Entries
        that are not followed (links to directories, broken links and link loops,
        pipes and other special files, unreadable directories) are listed in
        ``fSkippedEntries`` as (path, reason)."""
        files, self.fSkippedEntries = ListProjectFiles(self.fProjectDir.fPath, exclude)
        return [location.CLocalFileLocation(path) for path in files]

    def RunUntilIdle(self, max_iterations: int = 1_000_000) -> bool:
        return ostrelgtk.run_until_idle(max_iterations)

    def Shutdown(self) -> None:
        """Destroy the analysis manager (and coordinator) and drop the singletons."""
        if self.fCoordinator is not None:
            self.fCoordinator.destroy()
            self.fCoordinator = None
            self.fAnaMgr.fScanCoordinator = None
        cache = self.fAnaMgr.fInfoCache
        if cache.fDatabaseError is None:  # a failed write was reported already
            cache.WriteToDatabase()
        self.fAnaMgr.destroy()
        for name in ('fGuiMgr', 'fCacheMgr', 'fSavableMgr', 'fPrefMgr'):
            obj = getattr(self.fSingletons, name)
            if obj is not None:
                obj.destroy()
        singleton.ResetSingletons()


def ListProjectFiles(root: str, exclude: Iterable[str] = ()
                     ) -> tuple[list[str], list[tuple[str, str]]]:
    """(paths of the regular files under ``root``, [(path, reason) of entries not
    followed]); see ``CApplication.ProjectFiles``.  Links to files are followed;
    links to directories are not, so a link loop cannot make the walk endless."""
    skip = {'__pycache__', *exclude}
    files: list[str] = []
    skipped: list[tuple[str, str]] = []
    pending = [root]
    while pending:
        directory = pending.pop()
        try:
            with os.scandir(directory) as it:
                entries = sorted(it, key=lambda e: e.name)
        except OSError as exc:
            skipped.append((directory, f'directory not readable: {exc.strerror or exc}'))
            continue
        subdirs = []
        for entry in entries:
            if entry.name in skip:
                continue
            try:
                if entry.is_dir(follow_symlinks=False):
                    if not entry.name.startswith('.'):
                        subdirs.append(entry.path)
                elif entry.is_symlink():
                    try:
                        st = os.stat(entry.path)
                    except OSError as exc:
                        reason = ('symbolic link loop' if exc.errno == errno.ELOOP
                                  else 'broken symbolic link')
                        skipped.append((entry.path, reason))
                        continue
                    if stat.S_ISDIR(st.st_mode):
                        skipped.append((entry.path, 'symbolic link to a directory (not followed)'))
                    elif stat.S_ISREG(st.st_mode):
                        files.append(entry.path)
                    else:
                        skipped.append((entry.path, 'not a regular file'))
                elif entry.is_file(follow_symlinks=False):
                    files.append(entry.path)
                else:
                    skipped.append((entry.path, 'not a regular file'))
            except OSError as exc:
                skipped.append((entry.path, exc.strerror or str(exc)))
        # Depth first, in name order: files of a directory before its subdirectories'.
        pending.extend(reversed(subdirs))
    return files, skipped


def DefaultPythonPath(project_dir: str) -> list[location.CLocation]:
    """The project directory, then the standard library."""
    return [location.CLocalFileLocation(project_dir),
            location.CLocalFileLocation(analysismgr.StdlibDir())]


def CreateApplication(project_dir: str, db_path: str | None = None,
                      python_path: Iterable[str | location.CLocation] | None = None,
                      load_database: bool = True) -> CApplication:
    """Build the singletons and the analysis manager for ``project_dir``.

    ``db_path``: the sqlite file the information cache writes to (None: no
    database).  ``python_path``: directories (paths or locations) searched for
    imported modules; by default the project directory and the standard library.
    Derived information is built for the project's own files only.
    """
    project_dir = os.path.abspath(project_dir)
    if python_path is None:
        path_locs = DefaultPythonPath(project_dir)
    else:
        path_locs = [p if isinstance(p, location.CLocation) else location.CreateFromName(p)
                     for p in python_path]
    singleton.ResetSingletons()
    sing = singleton.GetSingletons()
    sing.Set('fPrefMgr', prefmgr.CPreferenceManager())
    sing.Set('fCacheMgr', cachemgr.CCacheManager())
    sing.Set('fSavableMgr', savable.CSavableManager())
    sing.Set('fFileAttribMgr', fileattribs.CFileAttributeManager())
    sing.Set('fGuiMgr', editor.CGuiManager())
    ana_mgr = analysismgr.CAnalysisManager(
        path_locs, project_dirs=[location.CLocalFileLocation(project_dir)], db_path=db_path)
    sing.Set('fAnalysisMgr', ana_mgr)
    if load_database:
        ana_mgr.fInfoCache.LoadFromDatabase()
    return CApplication(project_dir, ana_mgr)


def CreateScanCoordinator(app: CApplication,
                          idle_priority: int = kDefaultIdlePriority) -> Any:
    """Create the scan coordinator of ``app`` and order its two scans.

    This is where the application creates the compiled
    ``pysource.scancoordinator.CScanCoordinator(idle_priority, ana_mgr)``; the
    primary scan runs before the derived one among scans of equal priority, so
    the scan queue gets distinct orders for the two scan names.  CreateApplication
    does not call it: the caller attaches the coordinator once the compiled
    module is available.
    """
    from pysource import scancoordinator

    ana_mgr = app.fAnaMgr
    coordinator = scancoordinator.CScanCoordinator(idle_priority, ana_mgr)
    coordinator._fScanQueue.SetScansToOrder({ana_mgr.fPrimaryScanName: 0,
                                             ana_mgr.fDerivedScanName: 1})
    ana_mgr.fScanCoordinator = coordinator
    app.fCoordinator = coordinator
    # The scan queue follows the GUI manager's active document from the moment
    # the singletons announce a GUI manager; in this application the GUI exists
    # before the coordinator, so announce it again (as an application whose GUI
    # comes up after its analysis engine does).
    sing = app.fSingletons
    if sing.fGuiMgr is not None:
        sing.Set('fGuiMgr', sing.fGuiMgr)
    return coordinator


# -- timing --------------------------------------------------------------------------

kCoordinatorTime = 'coordinator'
kScannerTime = 'scanners'
kInfoCacheTime = 'information cache'
kHostTime = 'other host services'
kDisplayTime = 'display'

_kScannerClasses = ('CWholeFilePrimaryScanner', 'CSingleScopePrimaryScanner',
                    'CWholeFileSecondaryScanner', 'CSingleScopeSecondaryScanner')
_kScannerMethods = ('__init__', 'Scan', 'SaveToInfoCache', 'FilterNeedsScan', 'destroy')


def _TimedEntryPoints() -> list[tuple[Any, tuple[str, ...], str]]:
    """(class or module, names, category) of what the coordinator calls on the host."""
    entries: list[tuple[Any, tuple[str, ...], str]] = [
        (getattr(scopescanner, name), _kScannerMethods, kScannerTime)
        for name in _kScannerClasses]
    entries += [
        (scopescanner, ('CreateClassInstInfo',), kScannerTime),
        (scopeinfo.CInfoCache, ('GetScopeInfo', 'AddScopeInfo', 'GetAllImports',
                                'GetScansDoneForMultipleFiles', 'FinishedWithScans', 'Trim',
                                'WriteToDatabase', 'GetDiskMTime'), kInfoCacheTime),
        (scopeinfo.CLocCache, ('GetBuiltinLoc', 'WantDerivedInfo'), kInfoCacheTime),
        # Its handlers are the coordinator's ("needs-scan-added").
        (scopeinfo.CInfoCache, ('NoteNeedsScan',), kCoordinatorTime),
        (location, ('IsAsyncInspectLocation', '_WaitForInspectMultiple'), kHostTime),
        (location.CLocalFileLocation, ('GetParentDir', 'IsReady'), kHostTime),
        (analysismgr.CLocationDataCache, ('TreeBranchReady',), kHostTime),
        (analysismgr.CAnalysisFactory, ('FindBuiltinMod', 'GetAllLocsForName',
                                        'GetTypingLocations', 'GetSecondaryLocations',
                                        '_FindPrimaryLocsForNames'), kHostTime),
        (cachemgr.CCacheManager, ('GetAnalysis', 'DoesCacheBufferExist',
                                  '_ClearEOLBlindCacheAndScans'), kHostTime),
        (fileattribs.CFileAttributeManager, ('GetMultipleProbableMimeTypes',), kHostTime),
        (utils, ('IsPythonSource',), kHostTime),
        (analysis.CPySourceAnalysis, ('UpdateFromCache', 'FindScopeContainingLine'), kHostTime),
        (editor.CGuiManager, ('GetActiveDocument', 'GetDocuments'), kHostTime),
        (inferenceengine.CInferenceEngine, ('NewContext', 'GetScopeInfo'), kHostTime),
        (singleton, ('GetSingletons',), kHostTime),
    ]
    return entries


def _IsCoordinatorCallback(callback: Any) -> bool:
    owner = getattr(callback, '__self__', None)
    return type(owner).__module__ == 'pysource.scancoordinator'


class CHostTiming:
    """Time accounting of one run (see the module note).

    ``fAccount`` holds self times per category: ``kCoordinatorTime`` is the
    time inside the coordinator's own code (its idle, timeout and signal
    callbacks, and the calls the application makes on it through ``Call``) minus
    the time of the host calls it makes, which are charged to
    ``kScannerTime``, ``kInfoCacheTime`` or ``kHostTime``.  The hashing and
    comparing of locations that the coordinator's tables do is not timed
    separately: it counts as coordinator time.  ``fCallbackCalls`` counts the
    coordinator's callbacks by name (``_CB_DoIdleAnalysis``: the slices run).
    """

    def __init__(self) -> None:
        self.fAccount = timeaccount.CTimeAccount()
        self.fCallbackCalls: dict[str, int] = {}
        self._fInstalled = False

    def Install(self) -> None:
        if self._fInstalled:
            return
        self._fInstalled = True
        account = self.fAccount
        for owner, names, category in _TimedEntryPoints():
            account.TimeMethods(owner, names, category)
        # The coordinator's callbacks are timed where the main loop gets them.
        for name in ('idle_add', 'idle_add_while_alive', 'timeout_add_while_alive'):
            account.Replace(ostrelgtk, name, self._WrapScheduler(getattr(ostrelgtk, name)))
        for name in ('NoArgCallback', 'NoObjCallback'):
            account.Replace(ostrelgtk, name, self._WrapAdapter(getattr(ostrelgtk, name)))

    def Uninstall(self) -> None:
        if self._fInstalled:
            self.fAccount.Restore()
            self._fInstalled = False

    def Call(self, fn: Any, *args: Any, **kwargs: Any) -> Any:
        """Call one of the coordinator's operations, timed as coordinator time."""
        return self.fAccount.Wrap(fn, kCoordinatorTime)(*args, **kwargs)

    def _TimedCallback(self, callback: Any) -> Any:
        name = getattr(callback, '__name__', repr(callback))
        counts = self.fCallbackCalls
        timed = self.fAccount.Wrap(callback, kCoordinatorTime)

        def counted(*args: Any) -> Any:
            counts[name] = counts.get(name, 0) + 1
            return timed(*args)
        return counted

    def _WrapScheduler(self, schedule: Any) -> Any:
        def scheduled(*args: Any, **kwargs: Any) -> Any:
            args = tuple(self._TimedCallback(a) if _IsCoordinatorCallback(a) else a
                         for a in args)
            return schedule(*args, **kwargs)
        return scheduled

    def _WrapAdapter(self, adapter: Any) -> Any:
        def adapted(fn: Any) -> Any:
            return adapter(self._TimedCallback(fn) if _IsCoordinatorCallback(fn) else fn)
        return adapted
