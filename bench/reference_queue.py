"""Pure-Python scan queue: the executable model of the compiled one.

This module mirrors `pysource.scancoordinator._CSingleScanQueue` and
`_CScanQueue` statement for statement: the same fields in the same order,
the same calls on the collaborators in the same order, the same messages.
It is deliberately plain (no caching of attribute lookups, no shortcuts) so
that a difference between the two is a fault of one of them and not a
matter of style.  The host modules are reached through their module objects
at call time, so tests can patch e.g. `location.IsAsyncInspectLocation`.

One behaviour differs from the historical code on purpose:
`UpdateForVisibleDocuments` remembers the (scan name, priority) pairs it has
already handled per location.  Remembering them for the whole call meant
that the active document was never promoted while another visible document
had pending scans of the same scan name and priority.
"""

import bisect
import collections
import operator
import sys

import singleton
from guiutils import ostrelgtk
from ostrelbase import destroyable, location

from pysource import symbolinfo, usageordereddict

CScanItem = collections.namedtuple('CScanItem', ['loc', 'scope_name', 'scan_name', 'priority'])

kTypingModulePriority = 0
kInteractivePriority = 1
kBackgroundPriority = 2

kMaxWholeFilesPerCheck = 25
kMinRescanInterval = 5.0

CSingleQueueStatus = collections.namedtuple('CSingleQueueStatus', 'scan_name priority file_count')
CSingleQueueStatus.__module__ = __name__
CScanStatus = collections.namedtuple('CScanStatus', 'queue_status_list waiting_count')
CScanStatus.__module__ = __name__

_kSsizeMin = -(1 << 63)
_kSsizeMax = (1 << 63) - 1


def _AsMachineInt(value):
    """Converts like a C conversion to a signed 64-bit integer does: an object
    without __index__ is a TypeError, a value out of range an OverflowError."""
    value = operator.index(value)
    if not _kSsizeMin <= value <= _kSsizeMax:
        raise OverflowError('Python int too large to convert to C long')
    return value


def _ParseArgs(func_name, names, args, kwargs):
    """Binds exactly len(names) arguments, given by position or keyword, and
    reports a wrong count in the interpreter's own words for compiled code."""
    n = len(names)
    if len(args) > n:
        raise TypeError(f'{func_name}() takes exactly {n} positional argument'
                        f'{"" if n == 1 else "s"} ({len(args)} given)')
    values = list(args)
    for name in kwargs:
        if name not in names:
            raise TypeError(f"{func_name}() got an unexpected keyword argument '{name}'")
        if names.index(name) < len(args):
            raise TypeError(f"{func_name}() got multiple values for argument '{name}'")
    for name in names[len(args):]:
        if name not in kwargs:
            raise TypeError(f'{func_name}() takes exactly {n} positional argument'
                            f'{"" if n == 1 else "s"} ({len(args)} given)')
        values.append(kwargs[name])
    return values


def _ExpectedType(expected, obj):
    return TypeError(f'Expected {expected.__name__}, got {type(obj).__name__:.200}')


class _CSingleScanQueue(destroyable.CDestroyable):
    """One queue of scans of a single priority and scan order.

    All scans in one single queue are of the same priority and order; the scan
    name attached is not used to determine anything.  fOrderedDict maps
    locations to a sorted list of scopes to scan, and the order of locations is
    set by moving items in the ordered dictionary.  Scopes are always kept in
    alphabetical order so that binary searches can be used.  A scope name of
    '*' stands for all scopes and is then the only item in the list."""

    def __init__(self, *args, **kwargs):
        scan_name, priority, order = _ParseArgs(
            '__init__', ('scan_name', 'priority', 'order'), args, kwargs)
        destroyable.CDestroyable.__init__(self)
        self.fScanName = scan_name
        self.fPriority = _AsMachineInt(priority)
        self.fOrder = _AsMachineInt(order)
        self.fOrderedDict = usageordereddict.CUsageOrderedDict()


class _CScanQueue(destroyable.CDestroyable):
    """Manages the queue of scans.

    Scans are done in order of priority (lowest first) and then in scan order.
    There are assumed to be very few distinct priority and scan name values.
    All scans of a given location are kept together.

    Signals:
      locations-added: (scan-queue, locations-add-set) emitted in idle
      locations-removed: (scan-queue, locations-removed-set) emitted in idle
    """

    def __init__(self, location_data_cache):
        destroyable.CDestroyable.__init__(self, ('locations-added', 'locations-removed'))
        self.fAnyAsyncInspectLocation = False
        self._fScansToOrder = {}
        self._fOrderedQueues = []
        self._fPerLocationInfo = {}
        self._fPerScanNameCounts = {}
        self._fCompletedCount = collections.defaultdict(int)
        self._fPendingLocationsAdded = set()
        self._fPendingLocationsRemoved = set()
        self._fSignalEmitIdle = None
        self._fLocationDataCache = location_data_cache
        location_data_cache.connect_while_alive(
            'now-tree-branch-ready', self._CB_TreeBranchesNowReady, self)
        location_data_cache.connect_while_alive('inspect-failed', self._CB_InspectFailed, self)
        location_data_cache.connect_while_alive('cleared', self._CB_LocReadyCleared, self)
        self._fWaitingForInspectByLoc = {}
        self._fScanItemsWaitingForData = set()
        self._fActiveDocLoc = None
        self._fVisibleDocLocs = set()
        self._fGuiMgr = None
        singleton.GetSingletons().connect_while_alive(
            'changed', ostrelgtk.NoArgCallback(self._CB_SingletonChanged), self)
        self._fWholeFilesToCheck = {}

    def _destroy_impl(self):
        self.Clear()
        if self._fSignalEmitIdle is not None:
            ostrelgtk.idle_remove(self._fSignalEmitIdle)
            self._fSignalEmitIdle = None

    # ------------------------------------------------------------------
    # Structure, adding and removing

    def SetScansToOrder(self, scans_to_order):
        """Sets the dict mapping scan names to the order to do them in"""
        if scans_to_order is not None and not isinstance(scans_to_order, dict):
            raise _ExpectedType(dict, scans_to_order)
        self._fScansToOrder = scans_to_order

    def _GetSingleQueue(self, scan_name, priority):
        priority = _AsMachineInt(priority)
        if __debug__ and scan_name not in self._fScansToOrder:
            print('Scan without order: ' + str(scan_name))
        order = self._fScansToOrder.get(scan_name, 0)
        insert_at = len(self._fOrderedQueues)
        for i, single_queue in enumerate(self._fOrderedQueues):
            if single_queue.fPriority == priority and single_queue.fOrder == order:
                return single_queue
            if (single_queue.fPriority > priority
                    or (single_queue.fPriority == priority and single_queue.fOrder > order)):
                insert_at = i
                break
        single_queue = _CSingleScanQueue(scan_name, priority, order)
        self._fOrderedQueues.insert(insert_at, single_queue)
        return single_queue

    def _FindScanPriority(self, loc, scope_name, scan_name):
        """Returns the priority for scan in queue or None if not in queue"""
        info = self._fPerLocationInfo.get(loc)
        if info is not None:
            return info[1].get((scope_name, scan_name))
        waiting = self._fWaitingForInspectByLoc.get(loc)
        if waiting is None:
            return None
        waiting_items, check_priority = waiting
        if check_priority is not None:
            return check_priority
        for item in waiting_items:
            return item.priority
        assert False, 'should not be reached'
        return None

    def AddScanPairs(self, pair_seq, scan_name, priority=None, add_to_check=False):
        """Add seq of (loc, scope-name) pairs for given scan name and priority"""
        if priority is None:
            priority = kBackgroundPriority
        ready_pair_list = []
        try:
            for pair in pair_seq:
                if pair is None:
                    raise TypeError("'NoneType' object is not iterable")
                if not isinstance(pair, tuple):
                    raise _ExpectedType(tuple, pair)
                loc, scope_name = pair
                if not self.fAnyAsyncInspectLocation and location.IsAsyncInspectLocation(loc):
                    self.fAnyAsyncInspectLocation = True
                if self.IsTreeBranchReady(loc):
                    ready_pair_list.append(pair)
                else:
                    self._AddItemsWaitingForInspect(
                        loc, [CScanItem(loc, scope_name, scan_name, priority)])
                    if add_to_check:
                        self._SetWholeFileCheckWaitingForInspect(loc, priority)
        except BaseException:
            # The pairs read before the failure stay handled: the unready ones are
            # parked already, the ready ones are queued now.  The caller sees the
            # first error, not one the queueing itself might raise.
            if ready_pair_list:
                try:
                    self._AddReadyScanPairs(ready_pair_list, scan_name, priority, add_to_check)
                except Exception:  # noqa: BLE001, S110 - reported: the original error
                    pass
            raise
        if not ready_pair_list:
            return
        self._AddReadyScanPairs(ready_pair_list, scan_name, priority, add_to_check)

    def _AddReadyScanPairs(self, ready_pair_list, scan_name, priority, add_to_check):
        """Add pairs implementation that assumes all locations given are ready"""
        priority = _AsMachineInt(priority)
        single_queue = self._GetSingleQueue(scan_name, priority)
        for loc, scope_name in ready_pair_list:
            existing = self._FindScanPriority(loc, scope_name, scan_name)
            if existing is not None:
                if existing > priority:
                    self.RemoveScanTriple((loc, scope_name, scan_name), existing)
                else:
                    continue
            if scope_name != symbolinfo.kWildcardScope:
                whole = self._FindScanPriority(loc, symbolinfo.kWildcardScope, scan_name)
                if whole is not None and whole <= priority:
                    continue
            first = loc in self._fVisibleDocLocs
            name_list = single_queue.fOrderedDict.get(loc, None, first)
            if name_list is None:
                single_queue.fOrderedDict.Set(loc, [scope_name], first=first)
            elif name_list[0] == symbolinfo.kWildcardScope:
                continue
            elif scope_name == symbolinfo.kWildcardScope:
                for name in name_list:
                    self._RemoveScanFromPerLocationMap(loc, name, scan_name, priority)
                name_list[:] = [symbolinfo.kWildcardScope]
            else:
                i = bisect.bisect_left(name_list, scope_name)
                if 0 <= i < len(name_list) and name_list[i] != scope_name:
                    name_list.insert(i, scope_name)
                elif i == len(name_list):
                    name_list.append(scope_name)
                else:
                    continue
            self._AddScanToPerLocationMap(loc, scope_name, scan_name, priority)
            if add_to_check:
                self._fWholeFilesToCheck[loc] = priority

    def _AddScanToPerLocationMap(self, loc, scope_name, scan_name, priority):
        info = self._fPerLocationInfo.get(loc)
        if info is None:
            info = (collections.defaultdict(int), {})
            self._fPerLocationInfo[loc] = info
            self._UpdatePendingSets({loc}, set())
        per_name_counts, pending = info
        key = (scope_name, scan_name)
        assert key not in pending
        pending[key] = priority
        per_name_counts[scan_name] += 1
        scan_count, loc_count = self._fPerScanNameCounts.get(scan_name, (0, 0))
        scan_count += 1
        if per_name_counts[scan_name] == 1:
            loc_count += 1
        assert scan_count >= loc_count
        self._fPerScanNameCounts[scan_name] = (scan_count, loc_count)

    def _RemoveScanFromPerLocationMap(self, loc, scope_name, scan_name, priority):
        info = self._fPerLocationInfo.get(loc)
        if info is None:
            return False
        per_name_counts, pending = info
        key = (scope_name, scan_name)
        if pending.get(key) != priority:
            return False
        del pending[key]
        if not pending:
            del self._fPerLocationInfo[loc]
            self._UpdatePendingSets(None, {loc})
        per_name_counts[scan_name] -= 1
        if per_name_counts[scan_name] == 0:
            del per_name_counts[scan_name]
        counts = self._fPerScanNameCounts.get(scan_name)
        if counts is None:
            assert False
            return True
        scan_count, loc_count = counts
        scan_count -= 1
        if scan_name not in per_name_counts:
            loc_count -= 1
        if scan_count == 0:
            assert loc_count == 0
            del self._fPerScanNameCounts[scan_name]
        else:
            assert scan_count >= loc_count
            self._fPerScanNameCounts[scan_name] = (scan_count, loc_count)
        return True

    def RemoveScanTriple(self, scan_triple, priority=None, remove_waiting=True):
        """Remove Scan"""
        loc, scope_name, scan_name = scan_triple
        if remove_waiting and loc in self._fWaitingForInspectByLoc:
            waiting_items, _check_priority = self._fWaitingForInspectByLoc[loc]
            if priority is not None:
                to_remove = [CScanItem(loc, scope_name, scan_name, priority)]
            else:
                to_remove = [item for item in waiting_items
                             if item.scope_name == scope_name and item.scan_name == scan_name]
            waiting_items.difference_update(to_remove)
            if not waiting_items:
                self._fWaitingForInspectByLoc.pop(loc, None)
            # The location may have a ready scan as well: it leaves the ready
            # queue too, and the parked work stays parked.
            ready_removed = self._RemoveReadyScan(loc, scope_name, scan_name, priority)
            return len(to_remove) > 0 or ready_removed
        return self._RemoveReadyScan(loc, scope_name, scan_name, priority)

    def _RemoveReadyScan(self, loc, scope_name, scan_name, priority):
        if priority is None:
            priority = self._FindScanPriority(loc, scope_name, scan_name)
            if priority is None:
                return False
        if not self._RemoveScanFromPerLocationMap(loc, scope_name, scan_name, priority):
            return False
        single_queue = self._GetSingleQueue(scan_name, priority)
        name_list = single_queue.fOrderedDict.get(loc)
        i = bisect.bisect_left(name_list, scope_name)
        if 0 <= i < len(name_list) and name_list[i] == scope_name:
            del name_list[i]
            if not name_list:
                del single_queue.fOrderedDict[loc]
            return True
        return False

    def RemoveAllForLocations(self, loc_seq, scan_name_set=None, remove_waiting=True):
        """Remove all scans for all locations in given sequence"""
        for loc in loc_seq:
            some_scan_kept = False
            info = self._fPerLocationInfo.get(loc)
            if info is not None:
                for (scope_name, scan_name), priority in list(info[1].items()):
                    if scan_name_set is None or scan_name in scan_name_set:
                        self.RemoveScanTriple((loc, scope_name, scan_name), priority,
                                              remove_waiting)
                    else:
                        some_scan_kept = True
            if remove_waiting and not some_scan_kept:
                self._fWaitingForInspectByLoc.pop(loc, None)

    def Clear(self):
        removed = set(self._fPerLocationInfo)
        for single_queue in self._fOrderedQueues:
            single_queue.destroy()
        self._fOrderedQueues = []
        self._fPerLocationInfo.clear()
        self._fPerScanNameCounts.clear()
        self._fWaitingForInspectByLoc.clear()
        self._fCompletedCount.clear()
        self._fWholeFilesToCheck.clear()
        self._UpdatePendingSets(None, removed)
        self.fAnyAsyncInspectLocation = False

    def ScanCompleted(self, scan_item):
        key = CScanItem(scan_item.loc, scan_item.scope_name, scan_item.scan_name, None)
        self._fCompletedCount[key] += 1
        self.RemoveScanTriple((scan_item.loc, scan_item.scope_name, scan_item.scan_name),
                              scan_item.priority)

    # ------------------------------------------------------------------
    # Ordering, retrieval and queries

    def First(self):
        """Returns first scan in any queue as a CScanItem or CScanItem(None, None, None, None)
        if empty"""
        while True:
            item = self._FirstOrNone()
            if item is not None:
                return item

    def _FirstOrNone(self):
        for single_queue in self._fOrderedQueues:
            if len(single_queue.fOrderedDict) == 0:
                continue
            entry = single_queue.fOrderedDict._fFirst
            loc = entry.key
            name_list = entry.val
            if not self.IsTreeBranchReady(loc):
                self._MoveScansForLocToWaitingForInspect(loc)
                if __debug__:
                    new_first = single_queue.fOrderedDict._fFirst
                    assert new_first is None or new_first.key != loc
                return None
            return CScanItem(loc, name_list[0], single_queue.fScanName, single_queue.fPriority)
        return CScanItem(None, None, None, None)

    def PopWholeFilesToCheck(self, max_files=kMaxWholeFilesPerCheck):
        max_files = _AsMachineInt(max_files)
        if not self._fWholeFilesToCheck:
            return None
        pairs = []
        while len(pairs) <= max_files and self._fWholeFilesToCheck:
            pairs.append(self._fWholeFilesToCheck.popitem())
        if not self.fAnyAsyncInspectLocation:
            return pairs
        ready_pairs = []
        for loc, priority in pairs:
            if self.IsTreeBranchReady(loc):
                ready_pairs.append((loc, priority))
            else:
                self._MoveScansForLocToWaitingForInspect(loc, priority)
        return ready_pairs

    def GetPendingDictForLoc(self, loc):
        info = self._fPerLocationInfo.get(loc)
        if info is None:
            return None
        return info[1]

    def LocationInQueue(self, loc, scan_name=None):
        info = self._fPerLocationInfo.get(loc)
        if info is None:
            return False
        if scan_name is None:
            return True
        return scan_name in info[0]

    def Empty(self, include_waiting=True):
        if not include_waiting:
            return len(self._fPerLocationInfo) == 0
        return (len(self._fPerLocationInfo) == 0 and len(self._fWaitingForInspectByLoc) == 0
                and len(self._fScanItemsWaitingForData) == 0)

    def GetFileCount(self, scan_name, priority):
        count = 0
        for single_queue in self._fOrderedQueues:
            if priority is not None and single_queue.fPriority != priority:
                continue
            if scan_name is not None and single_queue.fScanName != scan_name:
                continue
            count += len(single_queue.fOrderedDict)
        return count

    def GetScanCount(self, scan_item):
        """Return number of times scan has been completed"""
        item = scan_item
        if item.priority is not None:
            item = CScanItem(item.loc, item.scope_name, item.scan_name, None)
        count = self._fCompletedCount.get(item, 0)
        if item.scope_name != symbolinfo.kWildcardScope:
            count += self._fCompletedCount.get(
                CScanItem(item.loc, symbolinfo.kWildcardScope, item.scan_name, None), 0)
        return count

    def GetWaitingCount(self):
        """Return number of files waiting for inspection or for data"""
        return len(self._fWaitingForInspectByLoc) + len(self._fScanItemsWaitingForData)

    def _CB_SingletonChanged(self):
        if self._fGuiMgr is None:
            self._fGuiMgr = singleton.GetSingletons().fGuiMgr
            if self._fGuiMgr is not None:
                self._fGuiMgr.connect_while_alive(
                    'active-document-changed',
                    ostrelgtk.NoArgCallback(self._CB_ActiveDocChanged), self)

    def _CB_ActiveDocChanged(self):
        from edit import editor
        doc = self._fGuiMgr.GetActiveDocument()
        if isinstance(doc, editor.CSourceEditor):
            active_loc = doc.fCache.fLocation
            visible_locs = self._fGuiMgr.GetDocuments(visible_only=True, include_help=False)
            self.UpdateForVisibleDocuments(active_loc, visible_locs)

    def UpdateForVisibleDocuments(self, active_loc, visible_locs):
        """Update priorities for active & visible locations"""
        visible = set(visible_locs)
        if active_loc is not None:
            visible.add(active_loc)
        if active_loc == self._fActiveDocLoc and visible == self._fVisibleDocLocs:
            return
        self._fActiveDocLoc = active_loc
        self._fVisibleDocLocs = visible
        loc_list = [self._fActiveDocLoc]
        for loc in self._fVisibleDocLocs:
            if loc != self._fActiveDocLoc:
                loc_list.append(loc)
        for loc in reversed(loc_list):
            info = self._fPerLocationInfo.get(loc)
            if info is None:
                continue
            handled = set()
            for (scope_name, scan_name), priority in list(info[1].items()):
                if (scan_name, priority) in handled:
                    continue
                handled.add((scan_name, priority))
                single_queue = self._GetSingleQueue(scan_name, priority)
                if priority <= kInteractivePriority:
                    single_queue.fOrderedDict.get(loc, None, True)
                else:
                    interactive_queue = self._GetSingleQueue(scan_name, kInteractivePriority)
                    self._MoveScansBetweenQueues(loc, None, single_queue, interactive_queue)

    def _MoveScansBetweenQueues(self, loc, names_to_move, from_queue, to_queue):
        """Move scans for given location from one queue to another; all names are moved
        if names_to_move is None.  Both queues must be for the same scan name."""
        assert from_queue.fScanName == to_queue.fScanName
        info = self._fPerLocationInfo.get(loc)
        if info is None:
            return
        pending = info[1]
        if names_to_move is None:
            names = from_queue.fOrderedDict.pop(loc, None)
        else:
            # Only names that are queued in from_queue move.
            names = []
            source = from_queue.fOrderedDict.get(loc)
            if source is not None:
                for name in names_to_move:
                    i = bisect.bisect_left(source, name)
                    if i < len(source) and source[i] == name:
                        del source[i]
                        names.append(name)
                if not source:
                    del from_queue.fOrderedDict[loc]
        if not names:
            return
        target = to_queue.fOrderedDict.get(loc, None, True)
        if not target:
            to_queue.fOrderedDict.Set(loc, names, first=True)
        elif target[0] == symbolinfo.kWildcardScope:
            for name in names:
                self._RemoveScanFromPerLocationMap(loc, name, to_queue.fScanName,
                                                   from_queue.fPriority)
            return
        elif names[0] == symbolinfo.kWildcardScope:
            for name in target:
                self._RemoveScanFromPerLocationMap(loc, name, to_queue.fScanName,
                                                   to_queue.fPriority)
            del target[:]
            target.append(symbolinfo.kWildcardScope)
        else:
            for name in names:
                bisect.insort_left(target, name)
        for name in names:
            pending[(name, to_queue.fScanName)] = to_queue.fPriority

    def PrintScanQueues(self, write=None, limit=100):
        """Print scan queues, up to limit scope names"""
        if write is None:
            write = sys.stdout.write

        def write_for_loc(loc, name_list, loc_limit):
            write(f'  {loc!r}\n')
            count = 1
            for name in name_list:
                if count >= loc_limit:
                    write('    ...\n')
                    break
                write(f'    {name}\n')
                count += 1
            return count

        write('_CScanQueue contents:\n')
        count = 0
        for single_queue in self._fOrderedQueues:
            write(f' Scan queue for {single_queue.fScanName}; priority={single_queue.fPriority} count={len(single_queue.fOrderedDict)}\n')
            if count < limit:
                for loc, name_list in single_queue.fOrderedDict.items():
                    if count >= limit:
                        write('  ...\n')
                        break
                    count += write_for_loc(loc, name_list, limit - count)
            else:
                write('  ...\n')

        if self._fWaitingForInspectByLoc:
            write('Waiting for ' + str(len(self._fWaitingForInspectByLoc))
                  + ' remote files to be inspected')
            for loc in list(self._fWaitingForInspectByLoc.keys())[:limit]:
                write(f'  File: {loc!r}\n')
            if len(self._fWaitingForInspectByLoc) >= limit:
                write('  ...\n')

        if self._fScanItemsWaitingForData:
            write(f'Waiting for remote on {len(self._fScanItemsWaitingForData)} scans\n')
            for item in list(self._fScanItemsWaitingForData)[:limit]:
                write(f'  Scan: {item!r}\n')
            if len(self._fScanItemsWaitingForData) >= limit:
                write('  ...\n')

    # ------------------------------------------------------------------
    # Waiting for data and deferred signals

    def IsTreeBranchReady(self, leaf_loc):
        if self.fAnyAsyncInspectLocation and location.IsAsyncInspectLocation(leaf_loc):
            return bool(self._fLocationDataCache.TreeBranchReady(leaf_loc, True))
        return True

    def _MoveScansForLocToWaitingForInspect(self, loc, check_whole_file_priority=None):
        pending = self.GetPendingDictForLoc(loc)
        if pending is None:
            return
        items = [CScanItem(loc, scope_name, scan_name, priority)
                 for (scope_name, scan_name), priority in pending.items()]
        if check_whole_file_priority is None:
            check_whole_file_priority = self._fWholeFilesToCheck.get(loc, None)
        self.RemoveAllForLocations([loc], remove_waiting=False)
        self._AddItemsWaitingForInspect(loc, items)
        self._SetWholeFileCheckWaitingForInspect(loc, check_whole_file_priority)

    def _AddItemsWaitingForInspect(self, loc, item_seq):
        entry = self._fWaitingForInspectByLoc.get(loc)
        if entry is None:
            entry = (set(), None)
            self._fWaitingForInspectByLoc[loc] = entry
        entry[0].update(item_seq)

    def _SetWholeFileCheckWaitingForInspect(self, loc, check_whole_file_priority):
        entry = self._fWaitingForInspectByLoc.get(loc)
        if entry is None:
            self._fWaitingForInspectByLoc[loc] = (set(), check_whole_file_priority)
        else:
            self._fWaitingForInspectByLoc[loc] = (entry[0], check_whole_file_priority)

    def _CB_TreeBranchesNowReady(self, data, ready_set):
        """Called when locations become ready"""
        ready = ready_set.intersection(self._fWaitingForInspectByLoc)
        if not ready:
            return
        groups = collections.defaultdict(list)
        for loc in ready:
            waiting_items, check_priority = self._fWaitingForInspectByLoc.pop(loc)
            flag = check_priority is not None
            for item in waiting_items:
                groups[(item.scan_name, item.priority, flag)].append((item.loc, item.scope_name))
        for (scan_name, priority, flag), pair_list in groups.items():
            self._AddReadyScanPairs(pair_list, scan_name, priority, flag)

    def _CB_InspectFailed(self, loc_data_cache, loc_set):
        return None

    def _CB_LocReadyCleared(self, loc_data_cache):
        return None

    def StartWaitingForData(self, scan_item):
        if scan_item in self._fScanItemsWaitingForData:
            return
        self.RemoveScanTriple((scan_item.loc, scan_item.scope_name, scan_item.scan_name),
                              scan_item.priority)
        self._fScanItemsWaitingForData.add(scan_item)

    def FinishedWaitingForData(self, scan_item):
        if scan_item not in self._fScanItemsWaitingForData:
            return
        self._fScanItemsWaitingForData.remove(scan_item)
        self.AddScanPairs([(scan_item.loc, scan_item.scope_name)], scan_item.scan_name,
                          scan_item.priority)

    def _UpdatePendingSets(self, added_set, removed_set):
        """Note locations added and removed, for the next emission from idle.

        If a location is added and then removed it ends up in both sets, but if it is
        removed and then added it ends up in neither.  None may be passed for no adds or
        no removals."""
        if added_set:
            readded = added_set.intersection(self._fPendingLocationsRemoved)
            if readded:
                self._fPendingLocationsRemoved.difference_update(readded)
                added_set = added_set.difference(readded)
            self._fPendingLocationsAdded.update(added_set)
        if removed_set:
            self._fPendingLocationsRemoved.update(removed_set)
        if self._fSignalEmitIdle is None:
            self._fSignalEmitIdle = ostrelgtk.idle_add(self._SignalEmitIdle)

    def _SignalEmitIdle(self):
        """Emits signals; to be used as an idle proc"""
        added = self._fPendingLocationsAdded
        self._fPendingLocationsAdded = set()
        removed = self._fPendingLocationsRemoved
        self._fPendingLocationsRemoved = set()
        self._fSignalEmitIdle = None
        if added:
            self.emit('locations-added', self, added)
        if removed:
            self.emit('locations-removed', self, removed)
