// Instance layouts of the module's three classes and the C++ entry points the
// units share.
//
// All three are heap types derived from the host's CDestroyable across the
// module boundary: their instances start with CDestroyableObject and carry
// their own fields after it.  Fields are constructed in tp_new (placement
// new) and destroyed in tp_dealloc, so a C++ field is always in a valid state
// even when __init__ never ran.
#pragma once

#include "host/destroyable_capi.h"
#include "host/pyref.hpp"

#include <cstdint>

namespace scancoord {

// ---- _CSingleScanQueue ----------------------------------------------------

struct SingleQueueFields {
  py::Ref fScanName;
  long long fPriority = 0;
  long long fOrder = 0;
  py::Ref fOrderedDict;
};

struct SingleQueueObject {
  CDestroyableObject base;
  SingleQueueFields f;
};

PyTypeObject *create_single_queue_type(py::Borrowed module);
// A new single queue, built as _CSingleScanQueue(scan_name, priority, order).
py::Ref new_single_queue(py::Borrowed scan_name, long long priority, long long order);
SingleQueueObject *as_single_queue(PyObject *o); // checked cast; throws TypeError

// ---- _CScanQueue ----------------------------------------------------------

struct ScanQueueFields {
  bool initialised = false; // set once __init__ has built every container
  bool fAnyAsyncInspectLocation = false;
  py::Ref _fScansToOrder;
  py::Ref _fOrderedQueues;
  py::Ref _fPerLocationInfo;
  py::Ref _fPerScanNameCounts;
  py::Ref _fCompletedCount;
  py::Ref _fPendingLocationsAdded;
  py::Ref _fPendingLocationsRemoved;
  py::Ref _fSignalEmitIdle;
  py::Ref _fLocationDataCache;
  py::Ref _fWaitingForInspectByLoc;
  py::Ref _fScanItemsWaitingForData;
  py::Ref _fActiveDocLoc;
  py::Ref _fVisibleDocLocs;
  py::Ref _fGuiMgr;
  py::Ref _fWholeFilesToCheck;
  // The single queue that _GetSingleQueue returned last and what it was
  // found for; see GetSingleQueue.
  struct {
    py::Ref scan_name, orders, queues, queue;
    long long priority = 0, order = 0;
    uint64_t orders_version = 0;
    Py_ssize_t index = 0;
  } last_single_queue;
};

struct ScanQueueObject {
  CDestroyableObject base;
  ScanQueueFields f;
};

PyTypeObject *create_scan_queue_type(py::Borrowed module);
ScanQueueObject *as_scan_queue(PyObject *o); // checked cast; throws TypeError

// ---- CScanCoordinator -----------------------------------------------------

PyTypeObject *create_coordinator_type(py::Borrowed module);

} // namespace scancoord
