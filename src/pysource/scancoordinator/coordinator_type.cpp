// CScanCoordinator: the Python face (slots, fields as getset descriptors,
// method table) and the dispatch of overridable operations.
//
// Dispatch: on an instance of the class itself, an overridable operation is a
// direct C++ call (no attribute lookup on the hot path).  On a subclass
// instance the attribute is looked up; when it is our own built-in method
// bound to this object the C++ code runs directly, otherwise the override is
// called with the same arguments.  The module's own calls all go through
// co::call, so an override sees every call the module makes.
#include "pysource/scancoordinator/coordinator.hpp"
#include "pysource/scancoordinator/typeutil.hpp"

namespace scancoord {

namespace {

using co::C;

C *coord(PyObject *self) { return reinterpret_cast<C *>(self); }
C *ready(PyObject *self) {
  C *c = coord(self);
  if (!c->f._fScanQueue) {
    PyErr_SetString(PyExc_RuntimeError, "CScanCoordinator.__init__() has not been called");
    py::throw_error();
  }
  return c;
}

int tp_init(PyObject *self, PyObject *args, PyObject *kwds){
    PY_GUARD(-1,
             {
               static const char *kwlist[] = {"idle_priority", "ana_mgr", nullptr};
               PyObject *idle_priority = nullptr, *ana_mgr = nullptr;
               if (!PyArg_ParseTupleAndKeywords(args, kwds, "OO:__init__",
                                                const_cast<char **>(kwlist), &idle_priority,
                                                &ana_mgr))
                 return -1;
               co::init(coord(self), arg(idle_priority), arg(ana_mgr));
               return 0;
             })}

SC_METHOD(Quitting){PY_GUARD(nullptr, {
  SC_NOARGS("Quitting");
  co::Quitting(coord(self));
  return none();
})} SC_METHOD(_destroy_impl){PY_GUARD(nullptr, {
  SC_NOARGS("_destroy_impl");
  co::destroy_impl(coord(self));
  return none();
})} SC_METHOD(SuspendIdleScans){PY_GUARD(nullptr, {
  SC_NOARGS("SuspendIdleScans");
  co::SuspendIdleScans(ready(self));
  return none();
})} SC_METHOD(ResumeIdleScans){PY_GUARD(nullptr, {
  SC_NOARGS("ResumeIdleScans");
  co::ResumeIdleScans(ready(self));
  return none();
})} SC_METHOD(_ScheduleIdle){PY_GUARD(nullptr, {
  SC_NOARGS("_ScheduleIdle");
  co::ScheduleIdle(ready(self));
  return none();
})} SC_METHOD(_CancelIdle){PY_GUARD(nullptr, {
  SC_NOARGS("_CancelIdle");
  co::CancelIdle(ready(self));
  return none();
})} SC_METHOD(_CB_ActiveEditLinenoChanged){PY_GUARD(nullptr, {
  SC_ARGS("_CB_ActiveEditLinenoChanged", 2, "ana", "new_lineno");
  co::CB_ActiveEditLinenoChanged(ready(self), arg(a[0]), arg(a[1]));
  return none();
})} SC_METHOD(_CB_NeedsScanAdded){PY_GUARD(nullptr, {
  SC_ARGS("_CB_NeedsScanAdded", 3, "info_cache", "needs_scan_added", "priority");
  co::CB_NeedsScanAdded(ready(self), arg(a[0]), arg(a[1]), arg(a[2]));
  return none();
})} SC_METHOD(AddNeedsScanSetToQueues){PY_GUARD(nullptr, {
  SC_ARGS("AddNeedsScanSetToQueues", 1, "needs_scan_set");
  co::AddNeedsScanSetToQueues(ready(self), arg(a[0]));
  return none();
})} SC_METHOD(_QueueBasicModules){PY_GUARD(nullptr, {
  SC_ARGS("_QueueBasicModules", 1, "end_time");
  return boolean(co::QueueBasicModules(ready(self), arg(a[0])));
})} SC_METHOD(QueuesEmpty){PY_GUARD(nullptr, {
  SC_ARGS("QueuesEmpty", 0, "include_waiting");
  return boolean(co::QueuesEmpty(ready(self), flag(a[0], true)));
})} SC_METHOD(AddParseablesToQueue){PY_GUARD(nullptr, {
  SC_ARGS("AddParseablesToQueue", 1, "loc_seq", "priority");
  py::Borrowed prio = a[1] ? arg(a[1]) : py::Borrowed(state->priorities[kBackgroundPriority]);
  co::AddParseablesToQueue(ready(self), arg(a[0]), prio);
  return none();
})} SC_METHOD(_CanSendToHelperProcess){PY_GUARD(nullptr, {
  SC_ARGS("_CanSendToHelperProcess", 2, "loc", "scope_name");
  return boolean(co::CanSendToHelperProcess(ready(self), arg(a[0]), arg(a[1])));
})} SC_METHOD(AddPairsToPrimaryQueue){PY_GUARD(nullptr, {
  SC_ARGS("AddPairsToPrimaryQueue", 1, "pairs", "first", "priority");
  co::AddPairsToPrimaryQueue(ready(self), arg(a[0]), a[1] ? arg(a[1]) : py::Borrowed(Py_True),
                             a[2] ? arg(a[2]) : py::Borrowed(Py_None));
  return none();
})} SC_METHOD(AddPairsToSecondaryQueue){PY_GUARD(nullptr, {
  SC_ARGS("AddPairsToSecondaryQueue", 1, "pairs", "first", "priority");
  co::AddPairsToSecondaryQueue(ready(self), arg(a[0]), a[1] ? arg(a[1]) : py::Borrowed(Py_True),
                               a[2] ? arg(a[2]) : py::Borrowed(Py_None));
  return none();
})} SC_METHOD(_CB_QueueLocationsAdded){PY_GUARD(nullptr, {
  SC_ARGS("_CB_QueueLocationsAdded", 2, "queue", "added");
  co::CB_QueueLocationsAdded(ready(self), arg(a[0]), arg(a[1]));
  return none();
})} SC_METHOD(LocationInPrimaryScanQueue){PY_GUARD(nullptr, {
  SC_ARGS("LocationInPrimaryScanQueue", 1, "loc");
  return boolean(co::LocationInPrimaryScanQueue(ready(self), arg(a[0])));
})} SC_METHOD(LocationInSecondaryScanQueue){PY_GUARD(nullptr, {
  SC_ARGS("LocationInSecondaryScanQueue", 1, "loc");
  return boolean(co::LocationInSecondaryScanQueue(ready(self), arg(a[0])));
})} SC_METHOD(LocationInScanQueues){PY_GUARD(nullptr, {
  SC_ARGS("LocationInScanQueues", 1, "loc");
  return boolean(co::LocationInScanQueues(ready(self), arg(a[0])));
})} SC_METHOD(RemoveLocationsFromQueue){PY_GUARD(nullptr, {
  SC_ARGS("RemoveLocationsFromQueue", 1, "to_remove");
  co::RemoveLocationsFromQueue(ready(self), arg(a[0]));
  return none();
})} SC_METHOD(FlushQueue){PY_GUARD(nullptr, {
  SC_NOARGS("FlushQueue");
  co::FlushQueue(ready(self));
  return none();
})} SC_METHOD(ClearLastScanInfo){PY_GUARD(nullptr, {
  SC_ARGS("ClearLastScanInfo", 1, "loc_iterable");
  co::ClearLastScanInfo(ready(self), arg(a[0]));
  return none();
})} SC_METHOD(GetStatus){PY_GUARD(nullptr, {
  SC_NOARGS("GetStatus");
  return co::GetStatus(ready(self)).release();
})} SC_METHOD(__EnsureStatusTimeout){PY_GUARD(nullptr, {
  SC_NOARGS("__EnsureStatusTimeout");
  co::EnsureStatusTimeout(ready(self));
  return none();
})} SC_METHOD(_CB_UpdateStatus){PY_GUARD(nullptr, {
  SC_NOARGS("_CB_UpdateStatus");
  return boolean(co::CB_UpdateStatus(ready(self)));
})} SC_METHOD(_ScheduleWriteToDatabaseIdle){PY_GUARD(nullptr, {
  SC_NOARGS("_ScheduleWriteToDatabaseIdle");
  co::ScheduleWriteToDatabaseIdle(ready(self));
  return none();
})} SC_METHOD(_CB_WriteToDatabase){PY_GUARD(nullptr, {
  SC_NOARGS("_CB_WriteToDatabase");
  co::CB_WriteToDatabase(ready(self));
  return none();
})} SC_METHOD(TryToScanDictNow){PY_GUARD(nullptr, {
  SC_ARGS("TryToScanDictNow", 4, "for_loc", "for_scope", "needs_scan_set", "end_time");
  double end_time = PyFloat_AsDouble(a[3]);
  if (end_time == -1.0 && PyErr_Occurred())
    return nullptr;
  return boolean(co::TryToScanDictNow(ready(self), arg(a[0]), arg(a[1]), arg(a[2]), end_time));
})} SC_METHOD(TryToScanNow){PY_GUARD(nullptr, {
  SC_ARGS("TryToScanNow", 4, "loc", "scope_name", "scan_name_list", "end_time", "do_secondary");
  double end_time = PyFloat_AsDouble(a[3]);
  if (end_time == -1.0 && PyErr_Occurred())
    return nullptr;
  return co::TryToScanNow(ready(self), arg(a[0]), arg(a[1]), arg(a[2]), end_time,
                          a[4] ? arg(a[4]) : py::Borrowed(Py_True))
      .release();
})} SC_METHOD(_TryToScanInstanceScopeNow){PY_GUARD(nullptr, {
  SC_ARGS("_TryToScanInstanceScopeNow", 3, "loc", "scope_name", "end_time");
  double end_time = PyFloat_AsDouble(a[2]);
  if (end_time == -1.0 && PyErr_Occurred())
    return nullptr;
  return co::TryToScanInstanceScopeNow(ready(self), arg(a[0]), arg(a[1]), end_time).release();
})} SC_METHOD(BuildInstanceScopeNoScanning){PY_GUARD(nullptr, {
  SC_ARGS("BuildInstanceScopeNoScanning", 3, "loc", "scope_name", "end_time");
  double end_time = PyFloat_AsDouble(a[2]);
  if (end_time == -1.0 && PyErr_Occurred())
    return nullptr;
  return co::BuildInstanceScopeNoScanning(ready(self), arg(a[0]), arg(a[1]), end_time).release();
})} SC_METHOD(_UpdateForHelperProcess){PY_GUARD(nullptr, {
  SC_NOARGS("_UpdateForHelperProcess");
  co::UpdateForHelperProcess(ready(self));
  return none();
})} SC_METHOD(_CB_DoIdleAnalysis) {
  PY_GUARD(nullptr, {
    SC_NOARGS("_CB_DoIdleAnalysis");
    return co::CB_DoIdleAnalysis(ready(self));
  })
}
double as_time(PyObject *o) {
  double v = PyFloat_AsDouble(o);
  if (v == -1.0 && PyErr_Occurred())
    py::throw_error();
  return v;
}
SC_METHOD(__DoScans){PY_GUARD(nullptr,
                              {
                                SC_ARGS("__DoScans", 1, "end_time");
                                co::DoScans(ready(self), as_time(a[0]));
                                return none();
                              })} SC_METHOD(__CheckWholeFiles){
    PY_GUARD(nullptr,
             {
               SC_ARGS("__CheckWholeFiles", 1, "end_time");
               return boolean(co::CheckWholeFiles(ready(self), as_time(a[0])));
             })} SC_METHOD(_DoSingleScan){
    PY_GUARD(nullptr,
             {
               SC_ARGS("_DoSingleScan", 2, "scan_item", "end_time");
               return boolean(co::DoSingleScan(ready(self), arg(a[0]), as_time(a[1])));
             })} SC_METHOD(__GetAnalysis){
    PY_GUARD(nullptr,
             {
               SC_ARGS("__GetAnalysis", 2, "loc", "create");
               return co::GetAnalysis(ready(self), arg(a[0]), flag(a[1], false)).release();
             })} SC_METHOD(__DoPrimaryWholeFileScan){
    PY_GUARD(nullptr,
             {
               SC_ARGS("__DoPrimaryWholeFileScan", 2, "scan_item", "end_time");
               return boolean(co::DoPrimaryWholeFileScan(ready(self), arg(a[0]), as_time(a[1])));
             })} SC_METHOD(__DoPrimarySingleScopeScan){
    PY_GUARD(nullptr,
             {
               SC_ARGS("__DoPrimarySingleScopeScan", 2, "scan_item", "end_time");
               return boolean(co::DoPrimarySingleScopeScan(ready(self), arg(a[0]), as_time(a[1])));
             })} SC_METHOD(__DoSecondaryWholeFileScan){
    PY_GUARD(nullptr,
             {
               SC_ARGS("__DoSecondaryWholeFileScan", 2, "scan_item", "end_time");
               return boolean(co::DoSecondaryWholeFileScan(ready(self), arg(a[0]), as_time(a[1])));
             })} SC_METHOD(__DoSecondarySingleScopeScan){
    PY_GUARD(nullptr,
             {
               SC_ARGS("__DoSecondarySingleScopeScan", 3, "loc", "scope_name", "end_time");
               return boolean(co::DoSecondarySingleScopeScan(ready(self), arg(a[0]), arg(a[1]),
                                                             as_time(a[2])));
             })} SC_METHOD(_WaitForScannerToBeReady){
    PY_GUARD(nullptr,
             {
               SC_ARGS("_WaitForScannerToBeReady", 2, "scanner", "scan_item");
               co::WaitForScannerToBeReady(ready(self), arg(a[0]), arg(a[1]));
               return none();
             })} SC_METHOD(__AddImportEquivsToQueue){
    PY_GUARD(nullptr,
             {
               SC_ARGS("__AddImportEquivsToQueue", 3, "imported_equivs", "dirloc", "priority");
               co::AddImportEquivsToQueue(ready(self), arg(a[0]), arg(a[1]), arg(a[2]));
               return none();
             })} SC_METHOD(__GetModtimeDict){
    PY_GUARD(nullptr,
             {
               SC_ARGS("__GetModtimeDict", 1, "loc_seq");
               return co::GetModtimeDict(ready(self), arg(a[0])).release();
             })} SC_METHOD(__GetModtimes){
    PY_GUARD(nullptr,
             {
               SC_ARGS("__GetModtimes", 2, "loc_seq", "completion_cb", "force");
               co::GetModtimes(ready(self), arg(a[0]), arg(a[1]),
                               a[2] ? arg(a[2]) : py::Borrowed(Py_False));
               return none();
             })}

// A class-private method, published under its mangled name.
#define SC_PRIVATE(name, doc)                                                                      \
  {"_CScanCoordinator" #name,                                                                      \
   reinterpret_cast<PyCFunction>(reinterpret_cast<void (*)()>(m_##name)),                          \
   METH_FASTCALL | METH_KEYWORDS, doc}

PyMethodDef methods[] = {
    SC_DEF(Quitting, "Called when quitting to stop analysis so that it doesn't clog the remote\n"
                     "agent connection, which must be flushed on quit"),
    SC_DEF(_destroy_impl, "Destroy proc to remove idle callback."),
    SC_DEF(SuspendIdleScans, nullptr),
    SC_DEF(ResumeIdleScans, nullptr),
    SC_DEF(_CB_ActiveEditLinenoChanged, nullptr),
    SC_DEF(_CB_NeedsScanAdded, nullptr),
    SC_DEF(AddNeedsScanSetToQueues, nullptr),
    SC_DEF(_QueueBasicModules, nullptr),
    SC_DEF(QueuesEmpty, nullptr),
    SC_DEF(AddParseablesToQueue, nullptr),
    SC_DEF(_CanSendToHelperProcess, nullptr),
    SC_DEF(AddPairsToPrimaryQueue, nullptr),
    SC_DEF(AddPairsToSecondaryQueue, nullptr),
    SC_DEF(_CB_QueueLocationsAdded, nullptr),
    SC_DEF(_ScheduleIdle, nullptr),
    SC_DEF(_CancelIdle, nullptr),
    SC_DEF(LocationInPrimaryScanQueue, nullptr),
    SC_DEF(LocationInSecondaryScanQueue, nullptr),
    SC_DEF(LocationInScanQueues, nullptr),
    SC_DEF(RemoveLocationsFromQueue, nullptr),
    SC_DEF(FlushQueue, nullptr),
    SC_DEF(ClearLastScanInfo, nullptr),
    SC_DEF(TryToScanDictNow, nullptr),
    SC_DEF(TryToScanNow, nullptr),
    SC_DEF(_TryToScanInstanceScopeNow, nullptr),
    SC_DEF(BuildInstanceScopeNoScanning, nullptr),
    SC_DEF(_UpdateForHelperProcess, nullptr),
    SC_DEF(_CB_DoIdleAnalysis, "Do analysis on individual lines in background mode."),
    SC_PRIVATE(__DoScans, "Do idle scans until time() > end_time."),
    SC_PRIVATE(__CheckWholeFiles,
               "Check whole file entries in the primary queue to see if they really need to be\n"
               "rescanned, adding them to the secondary queue if needed.  Returns True if ran\n"
               "out of time and False if not."),
    SC_DEF(_DoSingleScan, "Scan single queued item"),
    SC_PRIVATE(__GetAnalysis, nullptr),
    SC_PRIVATE(__DoPrimaryWholeFileScan, nullptr),
    SC_PRIVATE(__DoPrimarySingleScopeScan, "Idle analysis of a single scope"),
    SC_PRIVATE(__DoSecondaryWholeFileScan, nullptr),
    SC_PRIVATE(__DoSecondarySingleScopeScan, nullptr),
    SC_DEF(_WaitForScannerToBeReady, nullptr),
    SC_PRIVATE(__AddImportEquivsToQueue, nullptr),
    SC_PRIVATE(__GetModtimeDict, nullptr),
    SC_PRIVATE(__GetModtimes, nullptr),
    SC_DEF(GetStatus, nullptr),
    SC_PRIVATE(
        __EnsureStatusTimeout,
        "Make sure that the status timeout is installed or removed according to whether work is\n"
        "being done; removal is done by the callback itself"),
    SC_DEF(_CB_UpdateStatus, "Called periodically to update status"),
    SC_DEF(_ScheduleWriteToDatabaseIdle, "Schedule an idle that will call WriteToDatabase()"),
    SC_DEF(_CB_WriteToDatabase, nullptr),
    {nullptr, nullptr, 0, nullptr}};

// ---- fields --------------------------------------------------------------

struct Obj {
  CDestroyableObject base;
  co::Fields f;
};

#define SC_BOOL_GETTER(field)                                                                      \
  [](PyObject *self, void *) -> PyObject * { return boolean(coord(self)->f.field); }
#define SC_INT_GETTER(field)                                                                       \
  [](PyObject *self, void *) -> PyObject * { return PyLong_FromLongLong(coord(self)->f.field); }
#define SC_FLOAT_GETTER(field)                                                                     \
  [](PyObject *self, void *) -> PyObject * { return PyFloat_FromDouble(coord(self)->f.field); }

int set_analyze_found_imports(PyObject *self, PyObject *value, void *) {
  if (!value) {
    PyErr_SetString(PyExc_NotImplementedError, "__del__");
    return -1;
  }
  int t = PyObject_IsTrue(value);
  if (t < 0)
    return -1;
  coord(self)->f._fAnalyzeFoundImports = t != 0;
  return 0;
}

PyGetSetDef getset[] = {
    {"fAnaMgr", SC_REF_GETTER(Obj, fAnaMgr), nullptr, nullptr, nullptr},
    {"_fInfoCache", SC_REF_GETTER(Obj, _fInfoCache), nullptr, nullptr, nullptr},
    {"_fInferenceEngine", SC_REF_GETTER(Obj, _fInferenceEngine), nullptr, nullptr, nullptr},
    {"fPrefMgr", SC_REF_GETTER(Obj, fPrefMgr), nullptr, nullptr, nullptr},
    {"fCacheMgr", SC_REF_GETTER(Obj, fCacheMgr), nullptr, nullptr, nullptr},
    {"fSingletons", SC_REF_GETTER(Obj, fSingletons), nullptr, nullptr, nullptr},
    {"_fScanQueue", SC_REF_GETTER(Obj, _fScanQueue), nullptr, nullptr, nullptr},
    {"_CScanCoordinator__fActiveLoc", SC_REF_GETTER(Obj, fActiveLoc), nullptr, nullptr, nullptr},
    {"_CScanCoordinator__fActivePrimaryWholeFileScanners",
     SC_REF_GETTER(Obj, fActivePrimaryWholeFileScanners), nullptr, nullptr, nullptr},
    {"_CScanCoordinator__fActivePrimarySingleScopeScanners",
     SC_REF_GETTER(Obj, fActivePrimarySingleScopeScanners), nullptr, nullptr, nullptr},
    {"_CScanCoordinator__fActiveSecondaryWholeFileScanners",
     SC_REF_GETTER(Obj, fActiveSecondaryWholeFileScanners), nullptr, nullptr, nullptr},
    {"_CScanCoordinator__fActiveSecondarySingleScopeScanners",
     SC_REF_GETTER(Obj, fActiveSecondarySingleScopeScanners), nullptr, nullptr, nullptr},
    {"_fIncompleteScansByLoc", SC_REF_GETTER(Obj, _fIncompleteScansByLoc), nullptr, nullptr,
     nullptr},
    {"_fCompletedScanCount", SC_REF_GETTER(Obj, _fCompletedScanCount), nullptr, nullptr, nullptr},
    {"_fIdleProcId", SC_REF_GETTER(Obj, _fIdleProcId), nullptr, nullptr, nullptr},
    {"_fMTimeAtLastWholeFileCheck", SC_REF_GETTER(Obj, _fMTimeAtLastWholeFileCheck), nullptr,
     nullptr, nullptr},
    {"fIdlePriority", SC_INT_GETTER(fIdlePriority), nullptr, nullptr, nullptr},
    {"_CScanCoordinator__fCompletedLocs", SC_REF_GETTER(Obj, fCompletedLocs), nullptr, nullptr,
     nullptr},
    {"_CScanCoordinator__fStatusTimeout", SC_REF_GETTER(Obj, fStatusTimeout), nullptr, nullptr,
     nullptr},
    {"_fLastScanCompleted", SC_REF_GETTER(Obj, _fLastScanCompleted), nullptr, nullptr, nullptr},
    {"_CScanCoordinator__fQuitting", SC_BOOL_GETTER(fQuitting), nullptr, nullptr, nullptr},
    {"_fAllBasicModuleQueued", SC_BOOL_GETTER(_fAllBasicModuleQueued), nullptr, nullptr, nullptr},
    {"_fAnalyzeFoundImports", SC_BOOL_GETTER(_fAnalyzeFoundImports), set_analyze_found_imports,
     nullptr, nullptr},
    {"_fRemoteLocationsReady", SC_REF_GETTER(Obj, _fRemoteLocationsReady), nullptr, nullptr,
     nullptr},
    {"_fActiveScanNowTriples", SC_REF_GETTER(Obj, _fActiveScanNowTriples), nullptr, nullptr,
     nullptr},
    {"_fPendingScanNowTriples", SC_REF_GETTER(Obj, _fPendingScanNowTriples), nullptr, nullptr,
     nullptr},
    {"fActiveScanItem", SC_REF_GETTER(Obj, fActiveScanItem), nullptr, nullptr, nullptr},
    {"_fScanTripleCompletedCount", SC_REF_GETTER(Obj, _fScanTripleCompletedCount), nullptr, nullptr,
     nullptr},
    {"fLog", SC_REF_GETTER(Obj, fLog), nullptr, nullptr, nullptr},
    {"_fActiveIdleStart", SC_FLOAT_GETTER(_fActiveIdleStart), nullptr, nullptr, nullptr},
    {"_fLastLogQueue", SC_FLOAT_GETTER(_fLastLogQueue), nullptr, nullptr, nullptr},
    {"fWaitingForRemote", SC_BOOL_GETTER(fWaitingForRemote), nullptr, nullptr, nullptr},
    {"_fLocsQueuedInHelper", SC_REF_GETTER(Obj, _fLocsQueuedInHelper), nullptr, nullptr, nullptr},
    {"_fIdleToWriteToDatabase", SC_REF_GETTER(Obj, _fIdleToWriteToDatabase), nullptr, nullptr,
     nullptr},
    {"_fHelperCallbackObjConnected", SC_REF_GETTER(Obj, _fHelperCallbackObjConnected), nullptr,
     nullptr, nullptr},
    {"_fIdleScanSuspendCount", SC_INT_GETTER(_fIdleScanSuspendCount), nullptr, nullptr, nullptr},
    {nullptr, nullptr, nullptr, nullptr, nullptr}};

PyType_Slot slots[] = {{Py_tp_doc, const_cast<char *>("Class to coordinate scanning of files")},
                       {Py_tp_new, reinterpret_cast<void *>(typed_new<Obj>)},
                       {Py_tp_init, reinterpret_cast<void *>(tp_init)},
                       {Py_tp_dealloc, reinterpret_cast<void *>(typed_dealloc<Obj>)},
                       {Py_tp_traverse, reinterpret_cast<void *>(typed_traverse<Obj>)},
                       {Py_tp_clear, reinterpret_cast<void *>(typed_clear<Obj>)},
                       {Py_tp_methods, methods},
                       {Py_tp_getset, getset},
                       {0, nullptr}};

PyType_Spec spec = {"pysource.scancoordinator.CScanCoordinator", sizeof(Obj), 0,
                    Py_TPFLAGS_DEFAULT | Py_TPFLAGS_BASETYPE | Py_TPFLAGS_HAVE_GC, slots};

// ---- dispatch ------------------------------------------------------------

bool own(C *c, py::Borrowed name, FastMethod fn, py::Ref &override_out) {
  return own_method(reinterpret_cast<PyObject *>(c), state->CoordinatorType, name, fn,
                    override_out);
}

} // namespace

namespace co::call {

void ScheduleIdle(C *c) {
  py::Ref ov;
  if (own(c, PY_NAME("_ScheduleIdle"), m__ScheduleIdle, ov))
    return co::ScheduleIdle(c);
  py::call(ov);
}
void CancelIdle(C *c) {
  py::Ref ov;
  if (own(c, PY_NAME("_CancelIdle"), m__CancelIdle, ov))
    return co::CancelIdle(c);
  py::call(ov);
}
bool QueuesEmpty(C *c, bool include_waiting) {
  py::Ref ov;
  if (own(c, PY_NAME("QueuesEmpty"), m_QueuesEmpty, ov))
    return co::QueuesEmpty(c, include_waiting);
  return py::truth(py::call(ov, py::Borrowed(include_waiting ? Py_True : Py_False)));
}
void AddPairsToPrimaryQueue(C *c, Borrowed pairs, Borrowed first, Borrowed priority) {
  py::Ref ov;
  if (own(c, PY_NAME("AddPairsToPrimaryQueue"), m_AddPairsToPrimaryQueue, ov))
    return co::AddPairsToPrimaryQueue(c, pairs, first, priority);
  static py::Ref *kw = new py::Ref(py::check(PyTuple_Pack(1, PY_NAME("priority").get())));
  PyObject *argv[] = {pairs.get(), first.get(), priority.get()};
  py::call_kw(ov, argv, 2, *kw);
}
void AddPairsToSecondaryQueue(C *c, Borrowed pairs, Borrowed first, Borrowed priority) {
  py::Ref ov;
  if (own(c, PY_NAME("AddPairsToSecondaryQueue"), m_AddPairsToSecondaryQueue, ov))
    return co::AddPairsToSecondaryQueue(c, pairs, first, priority);
  static py::Ref *kw = new py::Ref(py::check(PyTuple_Pack(1, PY_NAME("priority").get())));
  PyObject *argv[] = {pairs.get(), first.get(), priority.get()};
  py::call_kw(ov, argv, 2, *kw);
}
void AddPairToSecondaryQueue(C *c, Borrowed loc, Borrowed scope, Borrowed first,
                             Borrowed priority) {
  py::Ref ov;
  if (own(c, PY_NAME("AddPairsToSecondaryQueue"), m_AddPairsToSecondaryQueue, ov))
    return co::AddPairToSecondaryQueue(c, loc, scope, first, priority);
  static py::Ref *kw = new py::Ref(py::check(PyTuple_Pack(1, PY_NAME("priority").get())));
  py::Ref pairs = one_pair_list(loc, scope);
  PyObject *argv[] = {pairs.get(), first.get(), priority.get()};
  py::call_kw(ov, argv, 2, *kw);
}
bool CanSendToHelperProcess(C *c, Borrowed loc, Borrowed scope_name) {
  py::Ref ov;
  if (own(c, PY_NAME("_CanSendToHelperProcess"), m__CanSendToHelperProcess, ov))
    return co::CanSendToHelperProcess(c, loc, scope_name);
  return py::truth(py::call(ov, loc, scope_name));
}
void ClearLastScanInfo(C *c, Borrowed loc_iterable) {
  py::Ref ov;
  if (own(c, PY_NAME("ClearLastScanInfo"), m_ClearLastScanInfo, ov))
    return co::ClearLastScanInfo(c, loc_iterable);
  py::call(ov, loc_iterable);
}

py::Ref GetStatus(C *c) {
  py::Ref ov;
  if (own(c, PY_NAME("GetStatus"), m_GetStatus, ov))
    return co::GetStatus(c);
  return py::call(ov);
}

void EnsureStatusTimeout(C *c) {
  py::Ref ov;
  if (own(c, PY_NAME("_CScanCoordinator__EnsureStatusTimeout"), m___EnsureStatusTimeout, ov))
    return co::EnsureStatusTimeout(c);
  py::call(ov);
}
void ScheduleWriteToDatabaseIdle(C *c) {
  py::Ref ov;
  if (own(c, PY_NAME("_ScheduleWriteToDatabaseIdle"), m__ScheduleWriteToDatabaseIdle, ov))
    return co::ScheduleWriteToDatabaseIdle(c);
  py::call(ov);
}
bool QueueBasicModules(C *c, Borrowed end_time) {
  py::Ref ov;
  if (own(c, PY_NAME("_QueueBasicModules"), m__QueueBasicModules, ov))
    return co::QueueBasicModules(c, end_time);
  return py::truth(py::call(ov, end_time));
}
void DoScans(C *c, double end_time) {
  py::Ref ov;
  if (own(c, PY_NAME("_CScanCoordinator__DoScans"), m___DoScans, ov))
    return co::DoScans(c, end_time);
  py::call(ov, py::floating(end_time));
}
bool CheckWholeFiles(C *c, double end_time) {
  py::Ref ov;
  if (own(c, PY_NAME("_CScanCoordinator__CheckWholeFiles"), m___CheckWholeFiles, ov))
    return co::CheckWholeFiles(c, end_time);
  return py::truth(py::call(ov, py::floating(end_time)));
}
bool DoSingleScan(C *c, Borrowed scan_item, double end_time) {
  py::Ref ov;
  if (own(c, PY_NAME("_DoSingleScan"), m__DoSingleScan, ov))
    return co::DoSingleScan(c, scan_item, end_time);
  return py::truth(py::call(ov, scan_item, py::floating(end_time)));
}
py::Ref GetAnalysis(C *c, Borrowed loc, bool create) {
  py::Ref ov;
  if (own(c, PY_NAME("_CScanCoordinator__GetAnalysis"), m___GetAnalysis, ov))
    return co::GetAnalysis(c, loc, create);
  return py::call(ov, loc, py::Borrowed(create ? Py_True : Py_False));
}
py::Ref GetModtimeDict(C *c, Borrowed loc_seq) {
  py::Ref ov;
  if (own(c, PY_NAME("_CScanCoordinator__GetModtimeDict"), m___GetModtimeDict, ov))
    return co::GetModtimeDict(c, loc_seq);
  return py::call(ov, loc_seq);
}
bool DoPrimaryWholeFileScan(C *c, Borrowed scan_item, double end_time) {
  py::Ref ov;
  if (own(c, PY_NAME("_CScanCoordinator__DoPrimaryWholeFileScan"), m___DoPrimaryWholeFileScan, ov))
    return co::DoPrimaryWholeFileScan(c, scan_item, end_time);
  return py::truth(py::call(ov, scan_item, py::floating(end_time)));
}
bool DoPrimarySingleScopeScan(C *c, Borrowed scan_item, double end_time) {
  py::Ref ov;
  if (own(c, PY_NAME("_CScanCoordinator__DoPrimarySingleScopeScan"), m___DoPrimarySingleScopeScan,
          ov))
    return co::DoPrimarySingleScopeScan(c, scan_item, end_time);
  return py::truth(py::call(ov, scan_item, py::floating(end_time)));
}
bool DoSecondaryWholeFileScan(C *c, Borrowed scan_item, double end_time) {
  py::Ref ov;
  if (own(c, PY_NAME("_CScanCoordinator__DoSecondaryWholeFileScan"), m___DoSecondaryWholeFileScan,
          ov))
    return co::DoSecondaryWholeFileScan(c, scan_item, end_time);
  return py::truth(py::call(ov, scan_item, py::floating(end_time)));
}
bool DoSecondarySingleScopeScan(C *c, Borrowed loc, Borrowed scope_name, double end_time) {
  py::Ref ov;
  if (own(c, PY_NAME("_CScanCoordinator__DoSecondarySingleScopeScan"),
          m___DoSecondarySingleScopeScan, ov))
    return co::DoSecondarySingleScopeScan(c, loc, scope_name, end_time);
  return py::truth(py::call(ov, loc, scope_name, py::floating(end_time)));
}
void AddImportEquivsToQueue(C *c, Borrowed imported_equivs, Borrowed dirloc, Borrowed priority) {
  py::Ref ov;
  if (own(c, PY_NAME("_CScanCoordinator__AddImportEquivsToQueue"), m___AddImportEquivsToQueue, ov))
    return co::AddImportEquivsToQueue(c, imported_equivs, dirloc, priority);
  py::call(ov, imported_equivs, dirloc, priority);
}
void WaitForScannerToBeReady(C *c, Borrowed scanner, Borrowed scan_item) {
  py::Ref ov;
  if (own(c, PY_NAME("_WaitForScannerToBeReady"), m__WaitForScannerToBeReady, ov))
    return co::WaitForScannerToBeReady(c, scanner, scan_item);
  py::call(ov, scanner, scan_item);
}
py::Ref BuildInstanceScopeNoScanning(C *c, Borrowed loc, Borrowed scope_name, double end_time) {
  py::Ref ov;
  if (own(c, PY_NAME("BuildInstanceScopeNoScanning"), m_BuildInstanceScopeNoScanning, ov))
    return co::BuildInstanceScopeNoScanning(c, loc, scope_name, end_time);
  return py::call(ov, loc, scope_name, py::floating(end_time));
}
py::Ref TryToScanNow(C *c, Borrowed loc, Borrowed scope_name, Borrowed scan_name_list,
                     double end_time, Borrowed do_secondary) {
  py::Ref ov;
  if (own(c, PY_NAME("TryToScanNow"), m_TryToScanNow, ov))
    return co::TryToScanNow(c, loc, scope_name, scan_name_list, end_time, do_secondary);
  return py::call(ov, loc, scope_name, scan_name_list, py::floating(end_time));
}
py::Ref TryToScanInstanceScopeNow(C *c, Borrowed loc, Borrowed scope_name, double end_time) {
  py::Ref ov;
  if (own(c, PY_NAME("_TryToScanInstanceScopeNow"), m__TryToScanInstanceScopeNow, ov))
    return co::TryToScanInstanceScopeNow(c, loc, scope_name, end_time);
  return py::call(ov, loc, scope_name, py::floating(end_time));
}
void AddNeedsScanSetToQueues(C *c, Borrowed needs_scan_set) {
  py::Ref ov;
  if (own(c, PY_NAME("AddNeedsScanSetToQueues"), m_AddNeedsScanSetToQueues, ov))
    return co::AddNeedsScanSetToQueues(c, needs_scan_set);
  py::call(ov, needs_scan_set);
}

} // namespace co::call

PyTypeObject *create_coordinator_type(py::Borrowed module) {
  return create_derived_type(module, &spec);
}

} // namespace scancoord
