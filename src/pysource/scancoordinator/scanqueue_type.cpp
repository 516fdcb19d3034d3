// _CScanQueue: the Python face (slots, fields as read-only getset
// descriptors, method table).  Every method parses its arguments, checks that
// __init__ has run, and calls the C++ logic in the scanqueue_* units.
#include "pysource/scancoordinator/scanqueue.hpp"
#include "pysource/scancoordinator/typeutil.hpp"
#include "host/hostmodules.hpp"

namespace scancoord {

namespace {

using sq::Q;

struct Fields : ScanQueueFields {
  template <typename F> void each(F &&f) {
    f(_fScansToOrder);
    f(_fOrderedQueues);
    f(_fPerLocationInfo);
    f(_fPerScanNameCounts);
    f(_fCompletedCount);
    f(_fPendingLocationsAdded);
    f(_fPendingLocationsRemoved);
    f(_fSignalEmitIdle);
    f(_fLocationDataCache);
    f(_fWaitingForInspectByLoc);
    f(_fScanItemsWaitingForData);
    f(_fActiveDocLoc);
    f(_fVisibleDocLocs);
    f(_fGuiMgr);
    f(_fWholeFilesToCheck);
    for (auto &a : single_queue_answers) {
      f(a.scan_name);
      f(a.orders);
      f(a.queues);
      f(a.queue);
    }
  }
  int visit(visitproc v, void *arg) {
    int r = 0;
    each([&](py::Ref &ref) {
      if (!r)
        r = ref.visit(v, arg);
    });
    return r ? r : keys.visit(v, arg);
  }
  void clear() {
    initialised = false;
    each([](py::Ref &ref) { ref.reset(); });
    keys.clear();
  }
};
static_assert(sizeof(Fields) == sizeof(ScanQueueFields));

struct Obj {
  CDestroyableObject base;
  Fields f;
};

const char kDoc[] =
    "Manages the queue of scans, ordered by priority (lowest first) and then scan order.\n\n"
    "Scans are done in order of priority (lowest first) and then in scan order.  There are\n"
    "assumed to be very few distinct priority and scan-name values.  All scans of a given\n"
    "location are kept together.\n\n"
    "Signals:\n"
    "  locations-added: (scan-queue, locations-add-set) emitted in idle\n"
    "  locations-removed: (scan-queue, locations-removed-set) emitted in idle";

constexpr const char *kNotInitialised = "_CScanQueue.__init__() has not been called";

Q *queue(PyObject *self) {
  Q *q = reinterpret_cast<Q *>(self);
  if (!q->f.initialised) {
    PyErr_SetString(PyExc_RuntimeError, kNotInitialised);
    py::throw_error();
  }
  return q;
}

PyObject *or_none(py::Ref r) { return r ? r.release() : none(); }

int tp_init(PyObject *self, PyObject *args, PyObject *kwds){
    PY_GUARD(-1,
             {
               static const char *kwlist[] = {"location_data_cache", nullptr};
               PyObject *cache = nullptr;
               if (!PyArg_ParseTupleAndKeywords(args, kwds, "O:__init__",
                                                const_cast<char **>(kwlist), &cache))
                 return -1;
               sq::init(reinterpret_cast<Q *>(self), arg(cache));
               return 0;
             })}

SC_METHOD(SetScansToOrder){PY_GUARD(nullptr,
                                    {
                                      SC_ARGS("SetScansToOrder", 1, "scans_to_order");
                                      sq::SetScansToOrder(queue(self), arg(a[0]));
                                      return none();
                                    })} SC_METHOD(_GetSingleQueue){
    PY_GUARD(nullptr,
             {
               SC_ARGS("_GetSingleQueue", 2, "scan_name", "priority");
               return sq::GetSingleQueue(queue(self), arg(a[0]), as_int64(arg(a[1]))).release();
             })} SC_METHOD(_FindScanPriority){
    PY_GUARD(nullptr,
             {
               SC_ARGS("_FindScanPriority", 3, "loc", "scope_name", "scan_name");
               return or_none(sq::FindScanPriority(queue(self), arg(a[0]), arg(a[1]), arg(a[2]),
                                                   py::Borrowed()));
             })} SC_METHOD(AddScanPairs){
    PY_GUARD(nullptr,
             {
               SC_ARGS("AddScanPairs", 2, "pair_seq", "scan_name", "priority", "add_to_check");
               // One call asks the location module's predicate for every pair:
               // it is read from the module once for the call.
               host::Snapshot snapshot;
               sq::AddScanPairs(queue(self), arg(a[0]), arg(a[1]), arg(a[2]), flag(a[3], false));
               return none();
             })} SC_METHOD(_AddReadyScanPairs){
    PY_GUARD(nullptr,
             {
               SC_ARGS("_AddReadyScanPairs", 4, "ready_pair_list", "scan_name", "priority",
                       "add_to_check");
               Q *q = queue(self);
               sq::PairList pairs;
               py::for_each(arg(a[0]), [&](py::Borrowed pair) {
                 py::Ref parts[2];
                 unpack(pair, 2, parts);
                 pairs.emplace_back(std::move(parts[0]), std::move(parts[1]));
               });
               sq::AddReadyScanPairs(q, pairs, arg(a[1]), arg(a[2]), flag(a[3], false));
               return none();
             })} SC_METHOD(_AddScanToPerLocationMap){
    PY_GUARD(nullptr,
             {
               SC_ARGS("_AddScanToPerLocationMap", 4, "loc", "scope_name", "scan_name", "priority");
               sq::AddScanToPerLocationMap(queue(self), arg(a[0]), arg(a[1]), arg(a[2]), arg(a[3]),
                                           py::Borrowed());
               return none();
             })} SC_METHOD(_RemoveScanFromPerLocationMap){
    PY_GUARD(nullptr,
             {
               SC_ARGS("_RemoveScanFromPerLocationMap", 4, "loc", "scope_name", "scan_name",
                       "priority");
               return boolean(sq::RemoveScanFromPerLocationMap(
                   queue(self), arg(a[0]), arg(a[1]), arg(a[2]), arg(a[3]), py::Borrowed()));
             })} SC_METHOD(RemoveScanTriple){
    PY_GUARD(nullptr,
             {
               SC_ARGS("RemoveScanTriple", 1, "scan_triple", "priority", "remove_waiting");
               Q *q = queue(self);
               py::Ref t[3];
               unpack(arg(a[0]), 3, t);
               return boolean(sq::RemoveScanTriple(q, t[0], t[1], t[2], arg(a[1]), flag(a[2], true),
                                                   py::Borrowed()));
             })} SC_METHOD(RemoveAllForLocations){
    PY_GUARD(nullptr,
             {
               SC_ARGS("RemoveAllForLocations", 1, "loc_seq", "scan_name_set", "remove_waiting");
               sq::RemoveAllForLocations(queue(self), arg(a[0]), arg(a[1]), flag(a[2], true));
               return none();
             })} SC_METHOD(Clear){PY_GUARD(nullptr,
                                           {
                                             SC_NOARGS("Clear");
                                             sq::Clear(queue(self));
                                             return none();
                                           })} SC_METHOD(ScanCompleted){
    PY_GUARD(nullptr,
             {
               SC_ARGS("ScanCompleted", 1, "scan_item");
               sq::ScanCompleted(queue(self), arg(a[0]));
               return none();
             })} SC_METHOD(_destroy_impl){PY_GUARD(nullptr,
                                                   {
                                                     SC_NOARGS("_destroy_impl");
                                                     sq::destroy_impl(reinterpret_cast<Q *>(self));
                                                     return none();
                                                   })} SC_METHOD(First){
    PY_GUARD(nullptr,
             {
               SC_NOARGS("First");
               return sq::First(queue(self)).release();
             })} SC_METHOD(_FirstOrNone){PY_GUARD(nullptr,
                                                  {
                                                    SC_NOARGS("_FirstOrNone");
                                                    return or_none(sq::FirstOrNone(queue(self)));
                                                  })} SC_METHOD(PopWholeFilesToCheck){
    PY_GUARD(nullptr,
             {
               SC_ARGS("PopWholeFilesToCheck", 0, "max_files");
               Py_ssize_t max_files = a[0] ? static_cast<Py_ssize_t>(as_int64(arg(a[0])))
                                           : static_cast<Py_ssize_t>(kMaxWholeFilesPerCheck);
               return sq::PopWholeFilesToCheck(queue(self), max_files).release();
             })} SC_METHOD(GetPendingDictForLoc){
    PY_GUARD(nullptr,
             {
               SC_ARGS("GetPendingDictForLoc", 1, "loc");
               return or_none(sq::GetPendingDictForLoc(queue(self), arg(a[0])));
             })} SC_METHOD(LocationInQueue){
    PY_GUARD(nullptr,
             {
               SC_ARGS("LocationInQueue", 1, "loc", "scan_name");
               return boolean(sq::LocationInQueue(queue(self), arg(a[0]), arg(a[1])));
             })} SC_METHOD(Empty){PY_GUARD(nullptr,
                                           {
                                             SC_ARGS("Empty", 0, "include_waiting");
                                             return boolean(
                                                 sq::Empty(queue(self), flag(a[0], true)));
                                           })} SC_METHOD(GetFileCount){
    PY_GUARD(nullptr,
             {
               SC_ARGS("GetFileCount", 2, "scan_name", "priority");
               return PyLong_FromSsize_t(sq::GetFileCount(queue(self), arg(a[0]), arg(a[1])));
             })} SC_METHOD(GetScanCount){
    PY_GUARD(nullptr,
             {
               SC_ARGS("GetScanCount", 1, "scan_item");
               return sq::GetScanCount(queue(self), arg(a[0])).release();
             })} SC_METHOD(GetWaitingCount){PY_GUARD(nullptr,
                                                     {
                                                       SC_NOARGS("GetWaitingCount");
                                                       return PyLong_FromSsize_t(
                                                           sq::GetWaitingCount(queue(self)));
                                                     })} SC_METHOD(UpdateForVisibleDocuments){
    PY_GUARD(nullptr,
             {
               SC_ARGS("UpdateForVisibleDocuments", 2, "active_loc", "visible_locs");
               sq::UpdateForVisibleDocuments(queue(self), arg(a[0]), arg(a[1]));
               return none();
             })} SC_METHOD(_MoveScansBetweenQueues){
    PY_GUARD(nullptr,
             {
               SC_ARGS("_MoveScansBetweenQueues", 4, "loc", "names_to_move", "from_queue",
                       "to_queue");
               sq::MoveScansBetweenQueues(queue(self), arg(a[0]), arg(a[1]), arg(a[2]), arg(a[3]));
               return none();
             })} SC_METHOD(_CB_SingletonChanged){PY_GUARD(nullptr,
                                                          {
                                                            SC_NOARGS("_CB_SingletonChanged");
                                                            sq::CB_SingletonChanged(queue(self));
                                                            return none();
                                                          })} SC_METHOD(_CB_ActiveDocChanged){
    PY_GUARD(nullptr,
             {
               SC_NOARGS("_CB_ActiveDocChanged");
               sq::CB_ActiveDocChanged(queue(self));
               return none();
             })} SC_METHOD(PrintScanQueues){
    PY_GUARD(nullptr,
             {
               SC_ARGS("PrintScanQueues", 0, "write", "limit");
               Py_ssize_t limit = a[1] ? static_cast<Py_ssize_t>(as_int64(arg(a[1]))) : 100;
               sq::PrintScanQueues(queue(self), arg(a[0]), limit);
               return none();
             })} SC_METHOD(IsTreeBranchReady){
    PY_GUARD(nullptr,
             {
               SC_ARGS("IsTreeBranchReady", 1, "leaf_loc");
               return boolean(sq::IsTreeBranchReady(queue(self), arg(a[0])));
             })} SC_METHOD(_MoveScansForLocToWaitingForInspect){
    PY_GUARD(nullptr,
             {
               SC_ARGS("_MoveScansForLocToWaitingForInspect", 1, "loc",
                       "check_whole_file_priority");
               sq::MoveScansForLocToWaitingForInspect(queue(self), arg(a[0]), arg(a[1]));
               return none();
             })} SC_METHOD(_AddItemsWaitingForInspect){
    PY_GUARD(nullptr,
             {
               SC_ARGS("_AddItemsWaitingForInspect", 2, "loc", "item_seq");
               sq::AddItemsWaitingForInspect(queue(self), arg(a[0]), arg(a[1]));
               return none();
             })} SC_METHOD(_SetWholeFileCheckWaitingForInspect){
    PY_GUARD(nullptr,
             {
               SC_ARGS("_SetWholeFileCheckWaitingForInspect", 2, "loc",
                       "check_whole_file_priority");
               sq::SetWholeFileCheckWaitingForInspect(queue(self), arg(a[0]), arg(a[1]));
               return none();
             })} SC_METHOD(_CB_TreeBranchesNowReady){
    PY_GUARD(nullptr,
             {
               SC_ARGS("_CB_TreeBranchesNowReady", 2, "data", "ready_set");
               sq::CB_TreeBranchesNowReady(queue(self), arg(a[0]), arg(a[1]));
               return none();
             })} SC_METHOD(_CB_InspectFailed){
    PY_GUARD(nullptr,
             {
               SC_ARGS("_CB_InspectFailed", 2, "loc_data_cache", "loc_set");
               (void)a;
               (void)self;
               return none();
             })} SC_METHOD(_CB_LocReadyCleared){PY_GUARD(nullptr,
                                                         {
                                                           SC_ARGS("_CB_LocReadyCleared", 1,
                                                                   "loc_data_cache");
                                                           (void)a;
                                                           (void)self;
                                                           return none();
                                                         })} SC_METHOD(StartWaitingForData){
    PY_GUARD(nullptr,
             {
               SC_ARGS("StartWaitingForData", 1, "scan_item");
               sq::StartWaitingForData(queue(self), arg(a[0]));
               return none();
             })} SC_METHOD(FinishedWaitingForData){
    PY_GUARD(nullptr,
             {
               SC_ARGS("FinishedWaitingForData", 1, "scan_item");
               sq::FinishedWaitingForData(queue(self), arg(a[0]));
               return none();
             })} SC_METHOD(_UpdatePendingSets){
    PY_GUARD(nullptr,
             {
               SC_ARGS("_UpdatePendingSets", 2, "added_set", "removed_set");
               sq::UpdatePendingSets(queue(self), arg(a[0]), arg(a[1]));
               return none();
             })} SC_METHOD(_SignalEmitIdle){PY_GUARD(nullptr,
                                                     {
                                                       SC_NOARGS("_SignalEmitIdle");
                                                       sq::SignalEmitIdle(queue(self));
                                                       return none();
                                                     })}

PyMethodDef methods[] = {
  SC_DEF(SetScansToOrder, "Sets the dict mapping scan names to the order to do them in"),
  SC_DEF(_GetSingleQueue, nullptr),
  SC_DEF(_FindScanPriority, "Returns the priority for scan in queue or None if not in queue"),
  SC_DEF(AddScanPairs, "Add seq of (loc, scope-name) pairs for given scan name and priority"),
  SC_DEF(_AddReadyScanPairs, "Add pairs implementation that assumes all locations given are ready"),
  SC_DEF(_AddScanToPerLocationMap, nullptr),
  SC_DEF(_RemoveScanFromPerLocationMap, nullptr),
  SC_DEF(RemoveScanTriple, "Remove Scan"),
  SC_DEF(RemoveAllForLocations, "Remove all scans for all locations in given sequence"),
  SC_DEF(Clear, nullptr),
  SC_DEF(ScanCompleted, nullptr),
  SC_DEF(_destroy_impl, nullptr),
  SC_DEF(First, "Returns first scan in any queue as a CScanItem; CScanItem(None, None, None, None) "
                "if empty"),
  SC_DEF(_FirstOrNone, nullptr),
  SC_DEF(PopWholeFilesToCheck, nullptr),
  SC_DEF(GetPendingDictForLoc, nullptr),
  SC_DEF(LocationInQueue, nullptr),
  SC_DEF(Empty, nullptr),
  SC_DEF(GetFileCount, nullptr),
  SC_DEF(GetScanCount, "Return number of times scan has been completed"),
  SC_DEF(GetWaitingCount, "Return number of files waiting for inspection or for data"),
  SC_DEF(UpdateForVisibleDocuments, "Update priorities for active & visible locations"),
  SC_DEF(_MoveScansBetweenQueues, nullptr),
  SC_DEF(_CB_SingletonChanged, nullptr),
  SC_DEF(_CB_ActiveDocChanged, nullptr),
  SC_DEF(PrintScanQueues, nullptr),
  SC_DEF(IsTreeBranchReady, nullptr),
  SC_DEF(_MoveScansForLocToWaitingForInspect, nullptr),
  SC_DEF(_AddItemsWaitingForInspect, nullptr),
  SC_DEF(_SetWholeFileCheckWaitingForInspect, nullptr),
  SC_DEF(_CB_TreeBranchesNowReady, "Called when locations become ready"),
  SC_DEF(_CB_InspectFailed, nullptr),
  SC_DEF(_CB_LocReadyCleared, nullptr),
  SC_DEF(StartWaitingForData, nullptr),
  SC_DEF(FinishedWaitingForData, nullptr),
  SC_DEF(_UpdatePendingSets,
         "If a location is added and then removed it ends up in both sets, but if it is "
         "removed and then added it ends up in neither; None may be passed for no adds or "
         "no removals"),
  SC_DEF(_SignalEmitIdle, "Emits signals; to be used as an idle proc"),
  {nullptr, nullptr, 0, nullptr}
};

PyObject *get_any_async(PyObject *self, void *) {
  return boolean(reinterpret_cast<Obj *>(self)->f.fAnyAsyncInspectLocation);
}

PyGetSetDef getset[] = {
    {"fAnyAsyncInspectLocation", get_any_async, nullptr, nullptr, nullptr},
    {"_fScansToOrder", SC_REF_GETTER(Obj, _fScansToOrder), nullptr, nullptr, nullptr},
    {"_fOrderedQueues", SC_REF_GETTER(Obj, _fOrderedQueues), nullptr, nullptr, nullptr},
    {"_fPerLocationInfo", SC_REF_GETTER(Obj, _fPerLocationInfo), nullptr, nullptr, nullptr},
    {"_fPerScanNameCounts", SC_REF_GETTER(Obj, _fPerScanNameCounts), nullptr, nullptr, nullptr},
    {"_fCompletedCount", SC_REF_GETTER(Obj, _fCompletedCount), nullptr, nullptr, nullptr},
    {"_fPendingLocationsAdded", SC_REF_GETTER(Obj, _fPendingLocationsAdded), nullptr, nullptr,
     nullptr},
    {"_fPendingLocationsRemoved", SC_REF_GETTER(Obj, _fPendingLocationsRemoved), nullptr, nullptr,
     nullptr},
    {"_fSignalEmitIdle", SC_REF_GETTER(Obj, _fSignalEmitIdle), nullptr, nullptr, nullptr},
    {"_fLocationDataCache", SC_REF_GETTER(Obj, _fLocationDataCache), nullptr, nullptr, nullptr},
    {"_fWaitingForInspectByLoc", SC_REF_GETTER(Obj, _fWaitingForInspectByLoc), nullptr, nullptr,
     nullptr},
    {"_fScanItemsWaitingForData", SC_REF_GETTER(Obj, _fScanItemsWaitingForData), nullptr, nullptr,
     nullptr},
    {"_fActiveDocLoc", SC_REF_GETTER(Obj, _fActiveDocLoc), nullptr, nullptr, nullptr},
    {"_fVisibleDocLocs", SC_REF_GETTER(Obj, _fVisibleDocLocs), nullptr, nullptr, nullptr},
    {"_fGuiMgr", SC_REF_GETTER(Obj, _fGuiMgr), nullptr, nullptr, nullptr},
    {"_fWholeFilesToCheck", SC_REF_GETTER(Obj, _fWholeFilesToCheck), nullptr, nullptr, nullptr},
    {nullptr, nullptr, nullptr, nullptr, nullptr}};

PyType_Slot slots[] = {{Py_tp_doc, const_cast<char *>(kDoc)},
                       {Py_tp_new, reinterpret_cast<void *>(typed_new<Obj>)},
                       {Py_tp_init, reinterpret_cast<void *>(tp_init)},
                       {Py_tp_dealloc, reinterpret_cast<void *>(typed_dealloc<Obj>)},
                       {Py_tp_traverse, reinterpret_cast<void *>(typed_traverse<Obj>)},
                       {Py_tp_clear, reinterpret_cast<void *>(typed_clear<Obj>)},
                       {Py_tp_methods, methods},
                       {Py_tp_getset, getset},
                       {0, nullptr}};

PyType_Spec spec = {"pysource.scancoordinator._CScanQueue", sizeof(Obj), 0,
                    Py_TPFLAGS_DEFAULT | Py_TPFLAGS_BASETYPE | Py_TPFLAGS_HAVE_GC, slots};

// ---- dispatch ------------------------------------------------------------

bool own(Q *q, py::Borrowed name, FastMethod fn, py::Ref &override_out) {
  return own_method(reinterpret_cast<PyObject *>(q), state->ScanQueueType, name, fn, override_out);
}

py::Ref pair_list(const sq::PairList &pairs) {
  py::Ref list = py::check(PyList_New(static_cast<Py_ssize_t>(pairs.size())));
  Py_ssize_t i = 0;
  pairs.for_each([&](sq::PairRef p) {
    PyList_SET_ITEM(list.get(), i++,
                    py::check(PyTuple_Pack(2, p.first.get(), p.second.get())).release());
  });
  return list;
}

py::Borrowed pybool(bool b) { return py::Borrowed(b ? Py_True : Py_False); }
py::Borrowed or_none_b(py::Borrowed b) { return b ? b : py::Borrowed(Py_None); }

} // namespace

namespace sq::call {
using py::Borrowed;
using py::Ref;

void AddScanPairs(Q *q, Borrowed pair_seq, Borrowed scan_name, Borrowed priority,
                  bool add_to_check) {
  py::Ref ov;
  if (own(q, PY_NAME("AddScanPairs"), m_AddScanPairs, ov))
    return sq::AddScanPairs(q, pair_seq, scan_name, priority, add_to_check);
  py::call(ov, pair_seq, scan_name, or_none_b(priority), pybool(add_to_check));
}
void AddReadyScanPairs(Q *q, const PairList &pairs, Borrowed scan_name, Borrowed priority,
                       bool add_to_check) {
  py::Ref ov;
  if (own(q, PY_NAME("_AddReadyScanPairs"), m__AddReadyScanPairs, ov))
    return sq::AddReadyScanPairs(q, pairs, scan_name, priority, add_to_check);
  py::call(ov, pair_list(pairs), scan_name, or_none_b(priority), pybool(add_to_check));
}
bool RemoveScanTriple(Q *q, Borrowed loc, Borrowed scope, Borrowed scan_name, Borrowed priority,
                      bool remove_waiting, Borrowed key, const LocInfo *known) {
  py::Ref ov;
  if (own(q, PY_NAME("RemoveScanTriple"), m_RemoveScanTriple, ov))
    return sq::RemoveScanTriple(q, loc, scope, scan_name, priority, remove_waiting, key, known);
  py::Ref triple = py::check(PyTuple_Pack(3, loc.get(), scope.get(), scan_name.get()));
  return py::truth(py::call(ov, triple, or_none_b(priority), pybool(remove_waiting)));
}
Ref FirstOrNone(Q *q) {
  py::Ref ov;
  if (own(q, PY_NAME("_FirstOrNone"), m__FirstOrNone, ov))
    return sq::FirstOrNone(q);
  py::Ref r = py::call(ov);
  return r.is_none() ? py::Ref() : r;
}
void UpdatePendingSets(Q *q, Borrowed added_set, Borrowed removed_set) {
  py::Ref ov;
  if (own(q, PY_NAME("_UpdatePendingSets"), m__UpdatePendingSets, ov))
    return sq::UpdatePendingSets(q, added_set, removed_set);
  py::call(ov, or_none_b(added_set), or_none_b(removed_set));
}
void LocationAdded(Q *q, Borrowed loc) {
  py::Ref ov;
  if (own(q, PY_NAME("_UpdatePendingSets"), m__UpdatePendingSets, ov))
    return sq::LocationAdded(q, loc);
  py::Ref added = py::new_set(), removed = py::new_set();
  py::set_add(added, loc);
  py::call(ov, added, removed);
}
void LocationRemoved(Q *q, Borrowed loc) {
  py::Ref ov;
  if (own(q, PY_NAME("_UpdatePendingSets"), m__UpdatePendingSets, ov))
    return sq::LocationRemoved(q, loc);
  py::Ref removed = py::new_set();
  py::set_add(removed, loc);
  py::call(ov, py::Borrowed(Py_None), removed);
}
Ref GetSingleQueue(Q *q, Borrowed scan_name, long long priority) {
  py::Ref ov;
  if (own(q, PY_NAME("_GetSingleQueue"), m__GetSingleQueue, ov))
    return sq::GetSingleQueue(q, scan_name, priority);
  py::Ref r = py::call(ov, scan_name, py::integer(priority));
  as_single_queue(r.get());
  return r;
}
bool IsTreeBranchReady(Q *q, Borrowed loc) {
  py::Ref ov;
  if (own(q, PY_NAME("IsTreeBranchReady"), m_IsTreeBranchReady, ov))
    return sq::IsTreeBranchReady(q, loc);
  return py::truth(py::call(ov, loc));
}
void MoveScansForLocToWaitingForInspect(Q *q, Borrowed loc, Borrowed check_priority) {
  py::Ref ov;
  if (own(q, PY_NAME("_MoveScansForLocToWaitingForInspect"), m__MoveScansForLocToWaitingForInspect,
          ov))
    return sq::MoveScansForLocToWaitingForInspect(q, loc, check_priority);
  py::call(ov, loc, or_none_b(check_priority));
}
void Clear(Q *q) {
  py::Ref ov;
  if (own(q, PY_NAME("Clear"), m_Clear, ov))
    return sq::Clear(q);
  py::call(ov);
}

} // namespace sq::call

PyTypeObject *create_scan_queue_type(py::Borrowed module) {
  return create_derived_type(module, &spec);
}

ScanQueueObject *as_scan_queue(PyObject *o) {
  if (!PyObject_TypeCheck(o, state->ScanQueueType)) {
    PyErr_Format(PyExc_TypeError, msg::kExpectedType, "_CScanQueue", Py_TYPE(o)->tp_name);
    py::throw_error();
  }
  return reinterpret_cast<ScanQueueObject *>(o);
}

} // namespace scancoord
