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
#include <unordered_map>
#include <utility>

namespace scancoord {

// The (scope name, scan name) key tuples of a scan queue, one object per pair
// of name objects.  Every pending dictionary, and the coordinator's record of
// completed scans, stores the same tuple for the same pair, so a location's
// key costs no allocation of its own and lookups with it compare stored keys
// by identity instead of reading each location's own tuple from memory.
// Keyed by the identities of the two names (the tuple holds them, so the
// addresses stay valid while the entry lives); bounded, and emptied whole
// when it is full (an entry is only a shortcut: an equal tuple serves as
// well).
class KeyTable {
public:
  static constexpr size_t kMaxEntries = 4096;
  // The stored tuple for (a, b), or nullptr.
  PyObject *find(PyObject *a, PyObject *b) const {
    auto it = map_.find({a, b});
    return it == map_.end() ? nullptr : it->second.get();
  }
  void add(PyObject *a, PyObject *b, py::Ref key) {
    if (map_.size() >= kMaxEntries)
      clear();
    map_.emplace(std::make_pair(a, b), std::move(key));
  }
  int visit(visitproc v, void *arg) const {
    for (const auto &e : map_)
      if (int r = e.second.visit(v, arg))
        return r;
    return 0;
  }
  // The table is emptied before any tuple is released.
  void clear() {
    Map old;
    old.swap(map_);
  }

private:
  struct PairHash {
    size_t operator()(const std::pair<PyObject *, PyObject *> &p) const noexcept {
      const auto a = reinterpret_cast<uintptr_t>(p.first),
                 b = reinterpret_cast<uintptr_t>(p.second);
      return static_cast<size_t>((a >> 4) * 0x9E3779B97F4A7C15ull ^ (b >> 4));
    }
  };
  using Map = std::unordered_map<std::pair<PyObject *, PyObject *>, py::Ref, PairHash>;
  Map map_;
};

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
  KeyTable keys;
  // The single queues that _GetSingleQueue returned last and what each was
  // found for (replaced in turn); see GetSingleQueue.
  struct SingleQueueAnswer {
    py::Ref scan_name, orders, queues, queue;
    long long priority = 0, order = 0;
    uint64_t orders_version = 0;
    Py_ssize_t index = 0;
  };
  static constexpr int kSingleQueueAnswers = 4;
  SingleQueueAnswer single_queue_answers[kSingleQueueAnswers];
  int next_single_queue_answer = 0;
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
