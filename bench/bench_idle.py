"""Idle-loop benchmark: draining whole-file scans through the coordinator's idle callback.

    ./run bench idle [--repeat N] [--files N] [--budget compiled|source] [--gc]

FILES local files are queued as whole-file primary scans (one AddPairsToPrimaryQueue
call, not timed); then `_CB_DoIdleAnalysis()` is called until it returns False, as
the main loop would.  Every file goes through the whole-file check, its primary
scan and the secondary scan that the primary one queues, so 2 x FILES scans
complete.  The scanners finish at their first Scan call and the collaborators do
nothing (no call recording), so the figures are the coordinator's own cost plus
one plain Python call per collaborator operation; the share of those calls is
measured separately by making the same calls per file from Python.

Reported, as medians over the repetitions:
  time per completed scan   wall time of the whole drain / completed scans
  Scan call past deadline   the latest a scanner's Scan was called relative to the
                            slice's end_time (negative: before the deadline)
  slice return past deadline  the latest a slice returned relative to its end_time
                            (slices that ran at least one scan)
The slice budget is the compiled-engine one (0.05 s) unless --budget source.
The garbage collector is off while timing (as timeit does) unless --gc.
"""
import argparse
import gc
import statistics
import sys
import time
from pathlib import Path

ROOT = Path(__file__).resolve().parent.parent
sys.path.insert(0, str(ROOT / 'tests'))

import singleton
from doubles import FakeGuiMgr, FakeLocationDataCache
from guiutils import ostrelgtk
from ostrelbase import destroyable, location

from pysource import _fastaccess, inferenceengine, scancoordinator, scopeinfo, scopescanner

kPrimary = 'primary'
kDerived = 'derived'
kTargetUsPerScan = 5.0
kFinished = scopescanner.kFinishedScanning

# None of the files is remote; the queue asks this for every added pair.  Membership
# in an empty set is a C-level call answering False, about the host's own cost.
location.IsAsyncInspectLocation = frozenset().__contains__

_now = time.time


class BenchLoc(str):
    """A local file: a path string (C-level hash and compare) with its URL."""

    def __init__(self, path):
        self.fUrl = path

    def GetParentDir(self):
        return kDir


kDir = BenchLoc('/home/dev/project')


# ---- collaborators that do nothing -------------------------------------------------------

class NullLog:
    fOutputFile = None  # logging off, as in a normal session

    def __init__(self, category):
        pass

    def __call__(self, *args):
        pass


class LocCache:
    def GetBuiltinLoc(self):
        return kDir

    def WantDerivedInfo(self, loc):
        return True


class InfoCache(scopeinfo.CInfoCache):
    def __init__(self):
        super().__init__(kPrimary, kDerived, loc_cache=LocCache())

    def GetDiskMTime(self, loc):
        return 100.0

    def GetScansDoneForMultipleFiles(self, mtime_dict):
        return {}

    def GetAllImports(self, loc_list):
        return ()

    def FinishedWithScans(self, loc, scope_name, scan_name):
        pass

    def Trim(self):
        pass

    def WriteToDatabase(self):
        pass


class ModFileCache(destroyable.CDestroyable):
    def __init__(self):
        super().__init__(('suspend', 'unsuspend'))


class Factory(destroyable.CDestroyable):
    def __init__(self):
        super().__init__(('import-resolution-changed',))
        self._fModFileCache = ModFileCache()

    def FindBuiltinMod(self):
        return None

    def GetSecondaryLocations(self, loc):
        return None

    def _destroy_impl(self):
        self._fModFileCache.destroy()


class CacheMgr:
    def DoesCacheBufferExist(self, loc, loaded_only=True):
        return None

    def GetAnalysis(self, loc, create):
        return None

    def _ClearEOLBlindCacheAndScans(self):
        pass


class SavableMgr(destroyable.CDestroyable):
    def __init__(self):
        super().__init__(('external-files-changed',))


class PyConfig:
    def __init__(self):
        self.python_path_locs = [kDir]


class AnaMgr:
    def __init__(self):
        self.fPrimaryScanName = kPrimary
        self.fDerivedScanName = kDerived
        self.fInfoCache = InfoCache()
        self.fInferenceEngine = None
        self.fLocationDataCache = FakeLocationDataCache()
        self.fAnalysisFactory = Factory()
        self.fPyConfig = PyConfig()
        self.fHelperProcessProxy = None
        self._fHelperProcessSupport = None


# ---- scanners that finish at once ---------------------------------------------------------

class Overrun:
    """The latest Scan call relative to its deadline, and the last deadline seen."""

    worst_call = float('-inf')
    last_end = None
    scans = 0


def _scan(self, end_time):
    Overrun.worst_call = max(Overrun.worst_call, _now() - end_time)
    Overrun.last_end = end_time
    Overrun.scans += 1
    return kFinished


class WholeFilePrimaryScanner(destroyable.CDestroyable):
    def __init__(self, loc, scan_name, *, incomplete_scope_set, log):
        destroyable.CDestroyable.__init__(self, ('scan-state-changed',))

    Scan = _scan


class WholeFileSecondaryScanner(scopescanner.CScanner):
    def __init__(self, loc, scan_name, log, /):
        destroyable.CDestroyable.__init__(self, ('scan-state-changed',))

    Scan = _scan

    def _destroy_impl(self):
        pass


# ---- one drain ----------------------------------------------------------------------------

class Setup:
    """Installs the doubles for the life of the benchmark."""

    def __init__(self, budget):
        self.fSaved = [(_fastaccess, 'CLogger', _fastaccess.CLogger),
                       (scopescanner, 'CWholeFilePrimaryScanner',
                        scopescanner.CWholeFilePrimaryScanner),
                       (scopescanner, 'CWholeFileSecondaryScanner',
                        scopescanner.CWholeFileSecondaryScanner),
                       (inferenceengine, '__file__', inferenceengine.__file__)]
        _fastaccess.CLogger = NullLog
        scopescanner.CWholeFilePrimaryScanner = WholeFilePrimaryScanner
        scopescanner.CWholeFileSecondaryScanner = WholeFileSecondaryScanner
        if budget == 'compiled':
            inferenceengine.__file__ = 'inferenceengine.cpython-311-x86_64-linux-gnu.so'
        else:
            inferenceengine.__file__ = 'inferenceengine.py'

    def Restore(self):
        for module, name, value in self.fSaved:
            setattr(module, name, value)


def drain_once(locs, keep_gc):
    """Queue every file, drain the idle loop; returns the figures of this run."""
    ostrelgtk.reset()
    singleton.ResetSingletons()
    ana_mgr = AnaMgr()
    gui_mgr = FakeGuiMgr()
    savable = SavableMgr()
    for name, obj in (('fPrefMgr', object()), ('fCacheMgr', CacheMgr()),
                      ('fSavableMgr', savable), ('fFileAttribMgr', object()),
                      ('fGuiMgr', gui_mgr), ('fAnalysisMgr', ana_mgr)):
        singleton.SetSingleton(name, obj)
    coord = scancoordinator.CScanCoordinator(150, ana_mgr)
    coord._fScanQueue.SetScansToOrder({kPrimary: 0, kDerived: 1})
    coord.AddPairsToPrimaryQueue([(loc, '*') for loc in locs], priority=2)

    Overrun.worst_call = float('-inf')
    Overrun.scans = 0
    worst_return = float('-inf')
    slices = 0
    callback = coord._CB_DoIdleAnalysis
    gc.collect()
    if not keep_gc:
        gc.disable()
    try:
        t0 = time.perf_counter()
        while True:
            Overrun.last_end = None
            more = callback()
            returned = _now()
            slices += 1
            if Overrun.last_end is not None:
                worst_return = max(worst_return, returned - Overrun.last_end)
            if not more:
                break
        elapsed = time.perf_counter() - t0
    finally:
        gc.enable()

    completed = sum(coord._fScanTripleCompletedCount.values())
    assert completed == Overrun.scans == 2 * len(locs), (completed, Overrun.scans)
    assert coord.QueuesEmpty() and len(coord._fLastScanCompleted) == len(locs)
    coord.destroy()
    for obj in (ana_mgr.fInfoCache, ana_mgr.fAnalysisFactory, ana_mgr.fLocationDataCache,
                gui_mgr, savable):
        obj.destroy()
    ostrelgtk.reset()
    singleton.ResetSingletons()
    return {'us_per_scan': elapsed / completed * 1e6, 'scan_late_ms': Overrun.worst_call * 1e3,
            'return_late_ms': worst_return * 1e3, 'slices': slices, 'seconds': elapsed}


def collaborators_once(locs, keep_gc):
    """The collaborator calls the coordinator makes per file (both scans), made from
    Python without the coordinator: the doubles' own share, in us per scan."""
    ana_mgr = AnaMgr()
    info, loc_cache, factory = ana_mgr.fInfoCache, ana_mgr.fInfoCache.fLocCache, \
        ana_mgr.fAnalysisFactory
    cache_mgr, log = CacheMgr(), NullLog('IdleAnalysis')
    end_time = _now() + 100.0
    gc.collect()
    if not keep_gc:
        gc.disable()
    try:
        t0 = time.perf_counter()
        for loc in locs:
            cache_mgr.DoesCacheBufferExist(loc, True)
            info.GetDiskMTime(loc)
            scanner = scopescanner.CWholeFilePrimaryScanner(
                loc, kPrimary, incomplete_scope_set=set(), log=log)
            log('Starting primary whole file scan: %r', loc)
            scanner.Scan(end_time)
            log('Finished primary whole file scan: %r', loc)
            scanner.destroy()
            info.GetAllImports([loc])
            loc.GetParentDir()
            factory.GetSecondaryLocations(loc)
            loc_cache.WantDerivedInfo(loc)
            info.FinishedWithScans(loc, '*', kPrimary)
            info.Trim()
            loc_cache.GetBuiltinLoc()
            loc_cache.WantDerivedInfo(loc)
            scanner = scopescanner.CWholeFileSecondaryScanner(loc, kDerived, log)
            log('Starting secondary whole file scan: %r', loc)
            scanner.Scan(end_time)
            log('Finished secondary whole file scan: %r', loc)
            scanner.destroy()
            info.FinishedWithScans(loc, '*', kDerived)
            info.Trim()
        elapsed = time.perf_counter() - t0
    finally:
        gc.enable()
    for obj in (info, factory, ana_mgr.fLocationDataCache):
        obj.destroy()
    return elapsed / (2 * len(locs)) * 1e6


def main(argv):
    parser = argparse.ArgumentParser(description=__doc__.splitlines()[0])
    parser.add_argument('--repeat', type=int, default=5, help='repetitions (default 5)')
    parser.add_argument('--files', type=int, default=20000,
                        help='number of files (default 20000; two scans each)')
    parser.add_argument('--budget', choices=['compiled', 'source'], default='compiled',
                        help='slice budget of a compiled (0.05 s, default) or uncompiled '
                             '(0.1 s) inference engine')
    parser.add_argument('--gc', action='store_true', help='keep the cyclic GC on while timing')
    args = parser.parse_args(argv)
    if args.repeat < 1 or args.files < 1:
        parser.error('--repeat and --files must be at least 1')

    locs = [BenchLoc(f'/home/dev/project/pkg{i // 200}/module{i}.py')
            for i in range(args.files)]
    setup = Setup(args.budget)
    try:
        runs = [drain_once(locs, args.gc) for _ in range(args.repeat)]
        doubles = statistics.median(collaborators_once(locs, args.gc)
                                    for _ in range(args.repeat))
    finally:
        setup.Restore()

    def median(key):
        return statistics.median(r[key] for r in runs)

    budget_s = 0.05 if args.budget == 'compiled' or not __debug__ else 0.1
    print(f'idle loop: {args.files} files, whole-file primary + secondary scan each = '
          f'{2 * args.files} scans; slice budget {budget_s} s; median of {args.repeat} runs; '
          f'GC {"on" if args.gc else "off"} while timed')
    rows = [
        ('time per completed scan', f'{median("us_per_scan"):.2f} us',
         f'<= {kTargetUsPerScan} us'),
        ('  of which collaborator doubles', f'{doubles:.2f} us', '(their calls alone)'),
        ('whole drain', f'{median("seconds") * 1e3:.1f} ms in {median("slices"):.0f} slices',
         ''),
        ('Scan call past deadline (worst)', f'{median("scan_late_ms"):+.3f} ms', ''),
        ('slice return past deadline (worst)', f'{median("return_late_ms"):+.3f} ms', ''),
    ]
    widths = [max(len(r[i]) for r in rows) for i in range(3)]
    for name, value, target in rows:
        print(f'  {name.ljust(widths[0])}  {value.rjust(widths[1])}  {target}')
    print('  per run (us/scan): ' + ', '.join(f'{r["us_per_scan"]:.2f}' for r in runs))
    met = median('us_per_scan') <= kTargetUsPerScan
    print('target ' + ('met' if met else 'missed'))
    return 0


if __name__ == '__main__':
    sys.exit(main(sys.argv[1:]))
