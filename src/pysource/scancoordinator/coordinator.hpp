// CScanCoordinator internals shared by its units (lifecycle and idle
// scheduling, queueing interface, helper process, the Python face).
//
// The coordinator owns one scan queue and drives it from the host's main
// loop.  At most one idle callback is installed at a time (_fIdleProcId), and
// none while idle scans are suspended or the project has no Python path.
//
// Overridable operations have one dispatch path (the `call::` functions
// below): on an instance of the class itself they are direct C++ calls; on a
// subclass instance the attribute is looked up and, if it is not our own
// method, the override is called.  Nothing in the module bypasses them.
#pragma once

#include "pysource/scancoordinator/module.hpp"
#include "pysource/scancoordinator/types.hpp"

namespace scancoord::co {

using py::Borrowed;
using py::Ref;

struct Fields {
  Ref fAnaMgr;
  Ref _fInfoCache;
  Ref _fInferenceEngine;
  Ref fPrefMgr;
  Ref fCacheMgr;
  Ref fSingletons;
  Ref _fScanQueue;
  Ref fActiveLoc;                          // __fActiveLoc
  Ref fActivePrimaryWholeFileScanners;     // __f...
  Ref fActivePrimarySingleScopeScanners;   // __f...
  Ref fActiveSecondaryWholeFileScanners;   // __f...
  Ref fActiveSecondarySingleScopeScanners; // __f...
  Ref _fIncompleteScansByLoc;
  Ref _fCompletedScanCount;
  Ref _fIdleProcId;
  Ref _fMTimeAtLastWholeFileCheck;
  long long fIdlePriority = 0;
  Ref fCompletedLocs; // __fCompletedLocs
  Ref fStatusTimeout; // __fStatusTimeout
  Ref _fLastScanCompleted;
  bool fQuitting = false; // __fQuitting
  bool _fAllBasicModuleQueued = false;
  bool _fAnalyzeFoundImports = false;
  Ref _fRemoteLocationsReady;
  Ref _fActiveScanNowTriples;
  Ref _fPendingScanNowTriples;
  Ref fActiveScanItem;
  Ref _fScanTripleCompletedCount;
  Ref fLog;
  double _fActiveIdleStart = 0.0;
  double _fLastLogQueue = 0.0;
  bool fWaitingForRemote = false;
  Ref _fLocsQueuedInHelper;
  Ref _fIdleToWriteToDatabase;
  Ref _fHelperCallbackObjConnected;
  long long _fIdleScanSuspendCount = 0;

  template <typename F> void each(F &&f) {
    Ref *refs[] = {&fAnaMgr,
                   &_fInfoCache,
                   &_fInferenceEngine,
                   &fPrefMgr,
                   &fCacheMgr,
                   &fSingletons,
                   &_fScanQueue,
                   &fActiveLoc,
                   &fActivePrimaryWholeFileScanners,
                   &fActivePrimarySingleScopeScanners,
                   &fActiveSecondaryWholeFileScanners,
                   &fActiveSecondarySingleScopeScanners,
                   &_fIncompleteScansByLoc,
                   &_fCompletedScanCount,
                   &_fIdleProcId,
                   &_fMTimeAtLastWholeFileCheck,
                   &fCompletedLocs,
                   &fStatusTimeout,
                   &_fLastScanCompleted,
                   &_fRemoteLocationsReady,
                   &_fActiveScanNowTriples,
                   &_fPendingScanNowTriples,
                   &fActiveScanItem,
                   &_fScanTripleCompletedCount,
                   &fLog,
                   &_fLocsQueuedInHelper,
                   &_fIdleToWriteToDatabase,
                   &_fHelperCallbackObjConnected};
    for (Ref *r : refs)
      f(*r);
  }
  int visit(visitproc v, void *arg) {
    int r = 0;
    each([&](Ref &ref) {
      if (!r)
        r = ref.visit(v, arg);
    });
    return r;
  }
  void clear() {
    each([](Ref &ref) { ref.reset(); });
  }
};

struct C {
  CDestroyableObject base;
  Fields f;
};

inline Borrowed self_of(C *c) { return Borrowed(reinterpret_cast<PyObject *>(c)); }
// The scan queue as its C++ object (TypeError if the field was replaced).
ScanQueueObject *queue(C *c);
// "None" for an unset field.
inline Ref or_none(const Ref &r) { return r ? r : Ref::none(); }
// A field or result that holds something other than None.
inline bool has(const Ref &r) { return r && !r.is_none(); }
// (a, b, ...) as a new tuple.
template <typename... A> Ref tuple_of(A... items) {
  return py::check(PyTuple_Pack(sizeof...(A), Borrowed(items).get()...));
}
// [(a, b)]: the one-pair list the queueing operations take.
inline Ref one_pair_list(Borrowed a, Borrowed b) {
  Ref list = py::check(PyList_New(1));
  PyList_SET_ITEM(list.get(), 0, tuple_of(a, b).release());
  return list;
}

// ---- lifecycle and idle scheduling ---------------------------------------
void init(C *c, Borrowed idle_priority, Borrowed ana_mgr);
void Quitting(C *c);
void destroy_impl(C *c);
void SuspendIdleScans(C *c);
void ResumeIdleScans(C *c);
void ScheduleIdle(C *c);
void CancelIdle(C *c);

// ---- queueing interface --------------------------------------------------
void AddPairsToPrimaryQueue(C *c, Borrowed pairs, Borrowed first, Borrowed priority);
void AddPairsToSecondaryQueue(C *c, Borrowed pairs, Borrowed first, Borrowed priority);
// AddPairsToSecondaryQueue([(loc, scope)], first, priority) without the list.
void AddPairToSecondaryQueue(C *c, Borrowed loc, Borrowed scope, Borrowed first, Borrowed priority);
void AddNeedsScanSetToQueues(C *c, Borrowed needs_scan_set);
void AddParseablesToQueue(C *c, Borrowed loc_seq, Borrowed priority);
bool QueueBasicModules(C *c, Borrowed end_time);
bool QueuesEmpty(C *c, bool include_waiting);
bool LocationInPrimaryScanQueue(C *c, Borrowed loc);
bool LocationInSecondaryScanQueue(C *c, Borrowed loc);
bool LocationInScanQueues(C *c, Borrowed loc);
void RemoveLocationsFromQueue(C *c, Borrowed to_remove);
void FlushQueue(C *c);
void ClearLastScanInfo(C *c, Borrowed loc_iterable);
void CB_NeedsScanAdded(C *c, Borrowed info_cache, Borrowed needs_scan_added, Borrowed priority);
void CB_ActiveEditLinenoChanged(C *c, Borrowed ana, Borrowed new_lineno);
void CB_QueueLocationsAdded(C *c, Borrowed queue, Borrowed added);

// ---- helper process ------------------------------------------------------
bool CanSendToHelperProcess(C *c, Borrowed loc, Borrowed scope_name);

// ---- idle loop -------------------------------------------------------------
double now_time();
void log(C *c, Borrowed message);
void log(C *c, Borrowed format, Borrowed value);
PyObject *CB_DoIdleAnalysis(C *c); // True, False or None; NULL with an exception
void DoScans(C *c, double end_time);
bool CheckWholeFiles(C *c, double end_time);
bool DoSingleScan(C *c, Borrowed scan_item, double end_time);
Ref GetAnalysis(C *c, Borrowed loc, bool create);

// ---- scan execution ----------------------------------------------------------
bool DoPrimaryWholeFileScan(C *c, Borrowed scan_item, double end_time);
bool DoPrimarySingleScopeScan(C *c, Borrowed scan_item, double end_time);
bool DoSecondaryWholeFileScan(C *c, Borrowed scan_item, double end_time);
bool DoSecondarySingleScopeScan(C *c, Borrowed loc, Borrowed scope_name, double end_time);
void WaitForScannerToBeReady(C *c, Borrowed scanner, Borrowed scan_item);

// ---- modification times and import equivalents ------------------------------
void AddImportEquivsToQueue(C *c, Borrowed imported_equivs, Borrowed dirloc, Borrowed priority);
Ref GetModtimeDict(C *c, Borrowed loc_seq);
void GetModtimes(C *c, Borrowed loc_seq, Borrowed completion_cb, Borrowed force);

// ---- synchronous scanning ----------------------------------------------------
bool TryToScanDictNow(C *c, Borrowed for_loc, Borrowed for_scope, Borrowed needs_scan_set,
                      double end_time);
Ref TryToScanNow(C *c, Borrowed loc, Borrowed scope_name, Borrowed scan_name_list, double end_time,
                 Borrowed do_secondary);
Ref TryToScanInstanceScopeNow(C *c, Borrowed loc, Borrowed scope_name, double end_time);
Ref BuildInstanceScopeNoScanning(C *c, Borrowed loc, Borrowed scope_name, double end_time);

// ---- helper process (continued) -------------------------------------------
void UpdateForHelperProcess(C *c);

// ---- status and database writes -----------------------------------------
Ref GetStatus(C *c);
void EnsureStatusTimeout(C *c);
bool CB_UpdateStatus(C *c);
void ScheduleWriteToDatabaseIdle(C *c);
void CB_WriteToDatabase(C *c);

// ---- overridable dispatch (defined with the Python face) -----------------
namespace call {
void ScheduleIdle(C *c);
void CancelIdle(C *c);
bool QueuesEmpty(C *c, bool include_waiting);
void AddPairsToPrimaryQueue(C *c, Borrowed pairs, Borrowed first, Borrowed priority);
void AddPairsToSecondaryQueue(C *c, Borrowed pairs, Borrowed first, Borrowed priority);
// One pair: an override receives [(loc, scope)], the class itself no list.
void AddPairToSecondaryQueue(C *c, Borrowed loc, Borrowed scope, Borrowed first, Borrowed priority);
bool CanSendToHelperProcess(C *c, Borrowed loc, Borrowed scope_name);
void ClearLastScanInfo(C *c, Borrowed loc_iterable);
Ref GetStatus(C *c);
void EnsureStatusTimeout(C *c);
void ScheduleWriteToDatabaseIdle(C *c);
bool QueueBasicModules(C *c, Borrowed end_time);
void DoScans(C *c, double end_time);
bool CheckWholeFiles(C *c, double end_time);
bool DoSingleScan(C *c, Borrowed scan_item, double end_time);
Ref GetAnalysis(C *c, Borrowed loc, bool create);
Ref GetModtimeDict(C *c, Borrowed loc_seq);
bool DoPrimaryWholeFileScan(C *c, Borrowed scan_item, double end_time);
bool DoPrimarySingleScopeScan(C *c, Borrowed scan_item, double end_time);
bool DoSecondaryWholeFileScan(C *c, Borrowed scan_item, double end_time);
bool DoSecondarySingleScopeScan(C *c, Borrowed loc, Borrowed scope_name, double end_time);
// Plain methods that the coordinator reaches through attribute lookup.
void AddImportEquivsToQueue(C *c, Borrowed imported_equivs, Borrowed dirloc, Borrowed priority);
void WaitForScannerToBeReady(C *c, Borrowed scanner, Borrowed scan_item);
Ref BuildInstanceScopeNoScanning(C *c, Borrowed loc, Borrowed scope_name, double end_time);
Ref TryToScanNow(C *c, Borrowed loc, Borrowed scope_name, Borrowed scan_name_list, double end_time,
                 Borrowed do_secondary);
Ref TryToScanInstanceScopeNow(C *c, Borrowed loc, Borrowed scope_name, double end_time);
void AddNeedsScanSetToQueues(C *c, Borrowed needs_scan_set);
} // namespace call

} // namespace scancoord::co
