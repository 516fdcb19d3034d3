"""Assembly of a working application around a project directory.

``CreateApplication(project_dir)`` builds the application singletons (preference,
cache, savable, file attribute and GUI managers) and the analysis manager of
the project, and returns a ``CApplication`` that holds them.  The main loop is
``guiutils.ostrelgtk``; run it with ``app.RunUntilIdle()`` or ``ostrelgtk.run()``.

The scan coordinator is attached by ``CreateScanCoordinator(app)``, kept apart so
that an application can be built (and tested) without the compiled module.
"""
from __future__ import annotations

import os
from collections.abc import Iterable
from typing import Any

import singleton
from cache import cachemgr, fileattribs, prefmgr, savable
from edit import editor
from guiutils import ostrelgtk
from ostrelbase import location

from pysource import analysismgr

kDefaultIdlePriority = ostrelgtk.PRIORITY_DEFAULT_IDLE


class CApplication:
    """A running application: the singletons plus the project's analysis manager."""

    def __init__(self, project_dir: str, ana_mgr: analysismgr.CAnalysisManager) -> None:
        self.fProjectDir = location.CLocalFileLocation(project_dir)
        self.fSingletons = singleton.GetSingletons()
        self.fAnaMgr = ana_mgr
        self.fCoordinator: Any = None

    def ProjectFiles(self) -> list[location.CLocation]:
        """The project's files (recursively, hidden directories skipped), sorted."""
        result = []
        for dirpath, dirnames, filenames in os.walk(self.fProjectDir.fPath):
            dirnames[:] = sorted(d for d in dirnames if not d.startswith('.')
                                 and d != '__pycache__')
            result.extend(location.CLocalFileLocation(os.path.join(dirpath, f))
                          for f in sorted(filenames))
        return result

    def RunUntilIdle(self, max_iterations: int = 1_000_000) -> bool:
        return ostrelgtk.run_until_idle(max_iterations)

    def Shutdown(self) -> None:
        """Destroy the analysis manager (and coordinator) and drop the singletons."""
        if self.fCoordinator is not None:
            self.fCoordinator.destroy()
            self.fCoordinator = None
            self.fAnaMgr.fScanCoordinator = None
        self.fAnaMgr.fInfoCache.WriteToDatabase()
        self.fAnaMgr.destroy()
        for name in ('fGuiMgr', 'fCacheMgr', 'fSavableMgr', 'fPrefMgr'):
            obj = getattr(self.fSingletons, name)
            if obj is not None:
                obj.destroy()
        singleton.ResetSingletons()


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
    return coordinator
