// CScanCoordinator: construction, the handlers it connects, shutdown, the
// suspend/resume counter and the idle callback's installation.
//
// Idle scheduling has two states: none scheduled (_fIdleProcId None) and
// scheduled.  Only _ScheduleIdle installs (and emits "scheduled"); only
// _CancelIdle, FlushQueue and the import-resolution handler remove (and emit
// "end").  The constructor's handlers are functions named on_<event>; each
// holds the coordinator, except on_external_mod, which is connected with a
// plain connect on an application-wide manager that outlives any project: it
// holds the coordinator weakly, so a destroyed coordinator can be freed while
// the connection stays in place.
#include "pysource/scancoordinator/coordinator.hpp"
#include "pysource/scancoordinator/scanqueue.hpp"
#include "host/anamgr.hpp"
#include "host/gui.hpp"
#include "host/hostmodules.hpp"
#include "host/infocache.hpp"
#include "host/mainloop.hpp"
#include "host/objectmodel.hpp"

namespace scancoord::co {

namespace {

namespace om = host::objectmodel;

constexpr const char *kSignals[] = {"scheduled", "end", "scan-status-update", "modtimes-updated"};

Borrowed signal_name(int i) {
  switch (i) {
  case 0:
    return PY_NAME(kSignals[0]);
  case 1:
    return PY_NAME(kSignals[1]);
  case 2:
    return PY_NAME(kSignals[2]);
  default:
    return PY_NAME(kSignals[3]);
  }
}

// Handlers are plain functions, like closures over the coordinator: each is
// bound to a one-item tuple holding it (its "cell"), not to the coordinator
// itself, so it does not present itself as a method of the coordinator.
C *coord(PyObject *cell) { return reinterpret_cast<C *>(PyTuple_GET_ITEM(cell, 0)); }

// ---- handlers made by the constructor ------------------------------------

PyObject *on_mod_cache_suspend(PyObject *self, PyObject *) {
  coord(self)->f.fWaitingForRemote = true;
  Py_RETURN_NONE;
}

PyObject *on_mod_cache_unsuspend(PyObject *self, PyObject *) {
  coord(self)->f.fWaitingForRemote = false;
  Py_RETURN_NONE;
}

PyObject *on_modified(PyObject *self, PyObject *ana){
    PY_GUARD(nullptr,
             {
               Ref loc = py::getattr(Borrowed(ana), host::names().fLocation);
               Ref locs = py::check(PyList_New(1));
               PyList_SET_ITEM(locs.get(), 0, loc.release());
               call::ClearLastScanInfo(coord(self), locs);
               Py_RETURN_NONE;
             })}

PyObject *on_external_mod(PyObject *cell, PyObject *args){
    PY_GUARD(nullptr,
             {
               PyObject *savable_mgr, *mod_dict;
               if (!PyArg_UnpackTuple(args, "on_external_mod", 2, 2, &savable_mgr, &mod_dict))
                 return nullptr;
               Ref self = Ref::borrow(PyWeakref_GetObject(PyTuple_GET_ITEM(cell, 0)));
               if (!self || self.is_none())
                 Py_RETURN_NONE; // the coordinator is gone
               Ref changed = py::check(PySet_New(mod_dict));
               Ref last = reinterpret_cast<C *>(self.get())->f._fLastScanCompleted;
               py::for_each(changed, [&](Borrowed loc) {
                 if (py::dict_contains(last, loc))
                   py::dict_del(last, loc);
               });
               Py_RETURN_NONE;
             })}

PyObject *on_buffer_change(PyObject *self, PyObject *args){
    PY_GUARD(nullptr,
             {
               if (PyTuple_GET_SIZE(args) < 1) {
                 PyErr_Format(PyExc_TypeError, msg::kArgCount, "on_buffer_change", "at least",
                              static_cast<Py_ssize_t>(1), "", PyTuple_GET_SIZE(args));
                 return nullptr;
               }
               Ref loc = py::getattr(Borrowed(PyTuple_GET_ITEM(args, 0)), host::names().fLocation);
               Ref last = coord(self)->f._fLastScanCompleted;
               if (py::dict_contains(last, loc))
                 py::dict_del(last, loc);
               Py_RETURN_NONE;
             })}

PyObject *on_server_changed(PyObject *self, PyObject *) {
  PyObject *ready = coord(self)->f._fRemoteLocationsReady.get();
  if (ready && PySet_Clear(ready) < 0)
    return nullptr;
  Py_RETURN_NONE;
}

PyObject *on_import_resolution_changed(PyObject *self, PyObject *){
    PY_GUARD(nullptr,
             {
               C *c = coord(self);
               if (host::anamgr::PythonPathLength(c->f.fAnaMgr) == 0) {
                 if (c->f._fIdleProcId && !c->f._fIdleProcId.is_none()) {
                   host::mainloop::idle_remove(c->f._fIdleProcId);
                   c->f._fIdleProcId = Ref::none();
                   om::emit(self_of(c), signal_name(1));
                 }
               } else if (!sq::Empty(queue(c), true)) {
                 call::ScheduleIdle(c);
               }
               Py_RETURN_NONE;
             })}

PyMethodDef def_on_mod_cache_suspend = {
  "on_mod_cache_suspend",
  on_mod_cache_suspend,
  METH_NOARGS,
  nullptr
};
PyMethodDef def_on_mod_cache_unsuspend = {"on_mod_cache_unsuspend", on_mod_cache_unsuspend,
                                          METH_NOARGS, nullptr};
PyMethodDef def_on_modified = {"on_modified", on_modified, METH_O, nullptr};
PyMethodDef def_on_external_mod = {"on_external_mod", on_external_mod, METH_VARARGS, nullptr};
PyMethodDef def_on_buffer_change = {"on_buffer_change", on_buffer_change, METH_VARARGS, nullptr};
PyMethodDef def_on_server_changed = {"on_server_changed", on_server_changed, METH_NOARGS, nullptr};
PyMethodDef def_on_import_resolution_changed = {"on_import_resolution_changed",
                                                on_import_resolution_changed, METH_NOARGS, nullptr};

Ref handler(PyMethodDef *def, Borrowed bound_to) {
  Ref cell = py::check(PyTuple_Pack(1, bound_to.get()));
  return py::check(PyCFunction_NewEx(def, cell.get(), nullptr));
}

Ref class_connect_while_alive(Borrowed cls, Borrowed signal, Borrowed cb, Borrowed owner) {
  return py::call_method(cls, host::names().class_connect_while_alive, signal, cb, owner);
}

Ref connect(Borrowed emitter, Borrowed signal, Borrowed cb) {
  return py::call_method(emitter, host::names().connect, signal, cb);
}

} // namespace

ScanQueueObject *queue(C *c) {
  if (!c->f._fScanQueue) {
    PyErr_SetString(PyExc_RuntimeError, "CScanCoordinator.__init__() has not been called");
    py::throw_error();
  }
  return as_scan_queue(c->f._fScanQueue.get());
}

void init(C *c, Borrowed idle_priority, Borrowed ana_mgr) {
  auto &f = c->f;
  Borrowed self = self_of(c);
  // 1. the base, with the signals this object emits
  {
    Ref signals = py::check(PyTuple_New(4));
    for (int i = 0; i < 4; ++i)
      PyTuple_SET_ITEM(signals.get(), i, signal_name(i).ref().release());
    om::base_init(self, signals);
  }
  // 2. collaborators
  f.fAnaMgr = ana_mgr.ref();
  {
    Ref info_cache = py::getattr(ana_mgr, PY_NAME("fInfoCache"));
    if (!info_cache.is_none()) {
      Ref cls = host::infocache::InfoCacheClass();
      int ok = PyObject_IsInstance(info_cache.get(), cls.get());
      if (ok < 0)
        py::throw_error();
      if (!ok) {
        PyErr_Format(PyExc_TypeError, msg::kExpectedType, "CInfoCache",
                     Py_TYPE(info_cache.get())->tp_name);
        py::throw_error();
      }
    }
    f._fInfoCache = info_cache;
  }
  f._fInferenceEngine = py::getattr(ana_mgr, PY_NAME("fInferenceEngine"));
  f.fPrefMgr = py::getattr(host::gui::GetSingletons(), PY_NAME("fPrefMgr"));
  f.fCacheMgr = py::getattr(host::gui::GetSingletons(), PY_NAME("fCacheMgr"));
  f.fSingletons = host::gui::GetSingletons();
  f._fIdleScanSuspendCount = 0;
  // 3. the scan queue
  {
    Ref data_cache = py::getattr(f.fAnaMgr, PY_NAME("fLocationDataCache"));
    f._fScanQueue =
        py::call(Borrowed(reinterpret_cast<PyObject *>(state->ScanQueueType)), data_cache);
    Ref cb = py::getattr(self, PY_NAME("_CB_QueueLocationsAdded"));
    om::connect_while_alive(f._fScanQueue, host::names().locations_added, cb, self);
  }
  // 4. the remaining fields
  f.fActiveLoc = Ref::none();
  f.fActivePrimaryWholeFileScanners = py::new_dict();
  f.fActivePrimarySingleScopeScanners = py::new_dict();
  f.fActiveSecondaryWholeFileScanners = py::new_dict();
  f.fActiveSecondarySingleScopeScanners = py::new_dict();
  f._fIncompleteScansByLoc =
      py::call(state->defaultdict, Borrowed(reinterpret_cast<PyObject *>(&PySet_Type)));
  f._fCompletedScanCount = py::new_dict();
  f._fIdleProcId = Ref::none();
  f._fMTimeAtLastWholeFileCheck = py::new_dict();
  f.fIdlePriority = as_int64(idle_priority);
  f.fCompletedLocs = py::new_set();
  f.fStatusTimeout = Ref::none();
  f._fLastScanCompleted = py::new_dict();
  f.fQuitting = false;
  f._fAllBasicModuleQueued = false;
  f._fAnalyzeFoundImports = true;
  f._fRemoteLocationsReady = py::new_set();
  f._fActiveScanNowTriples = py::new_set();
  f._fPendingScanNowTriples = py::new_set();
  f.fActiveScanItem = Ref::none();
  f._fScanTripleCompletedCount = py::call(state->defaultdict, state->int_type);
  f.fLog =
      py::call(py::getattr(host::modules->fastaccess, PY_NAME("CLogger")), PY_NAME("IdleAnalysis"));
  f._fActiveIdleStart = -1.0;
  f._fLastLogQueue = -1.0;
  f.fWaitingForRemote = false;
  f._fIdleToWriteToDatabase = Ref::none();
  // 5. connections
  {
    Ref mod_file_cache =
        py::getattr(host::anamgr::AnalysisFactory(ana_mgr), PY_NAME("_fModFileCache"));
    Ref cb = host::mainloop::NoArgCallback(handler(&def_on_mod_cache_suspend, self));
    om::connect_while_alive(mod_file_cache, PY_NAME("suspend"), cb, self);
    cb = host::mainloop::NoArgCallback(handler(&def_on_mod_cache_unsuspend, self));
    om::connect_while_alive(mod_file_cache, PY_NAME("unsuspend"), cb, self);
  }
  Ref analysis_cls = py::getattr(host::modules->analysis, PY_NAME("CPySourceAnalysis"));
  class_connect_while_alive(analysis_cls, PY_NAME("modified"), handler(&def_on_modified, self),
                            self);
  {
    Ref savable_mgr = py::getattr(f.fSingletons, PY_NAME("fSavableMgr"));
    Ref weak_self = py::check(PyWeakref_NewRef(self.get(), nullptr));
    connect(savable_mgr, PY_NAME("external-files-changed"),
            handler(&def_on_external_mod, weak_self));
  }
  class_connect_while_alive(py::getattr(host::modules->textcache, PY_NAME("CTextCache")),
                            PY_NAME("text-modified"), handler(&def_on_buffer_change, self), self);
  class_connect_while_alive(analysis_cls, PY_NAME("active-edit-lineno-changed"),
                            py::getattr(self, PY_NAME("_CB_ActiveEditLinenoChanged")), self);
  if (py::truth(py::getattr(host::modules->config, PY_NAME("kAvailRemoteSupport")))) {
    Ref fromlist =
        py::check(PyTuple_Pack(2, PY_NAME("remoteclient").get(), PY_NAME("containers").get()));
    Ref pkg =
        py::check(PyImport_ImportModuleLevel("ostrelbase", nullptr, nullptr, fromlist.get(), 0));
    Ref remoteclient = py::getattr(pkg, PY_NAME("remoteclient"));
    Ref containers = py::getattr(pkg, PY_NAME("containers"));
    Ref cb = host::mainloop::NoArgCallback(handler(&def_on_server_changed, self));
    class_connect_while_alive(py::getattr(remoteclient, PY_NAME("CRemoteServerManager")),
                              PY_NAME("server-stopped"), cb, self);
    cb = host::mainloop::NoArgCallback(handler(&def_on_server_changed, self));
    class_connect_while_alive(py::getattr(containers, PY_NAME("CContainerInspectorManager")),
                              PY_NAME("server-stopped"), cb, self);
  }
  connect(f._fInfoCache, PY_NAME("needs-scan-added"),
          py::getattr(self, PY_NAME("_CB_NeedsScanAdded")));
  {
    Ref cb = host::mainloop::NoArgCallback(handler(&def_on_import_resolution_changed, self));
    connect(host::anamgr::AnalysisFactory(f.fAnaMgr), PY_NAME("import-resolution-changed"), cb);
  }
  // 6.
  f._fLocsQueuedInHelper = py::new_set();
  f._fHelperCallbackObjConnected = Ref::none();
}

void Quitting(C *c) { c->f.fQuitting = true; }

void destroy_impl(C *c) {
  if (!c->f._fScanQueue)
    return; // never constructed: nothing of ours to release
  call::CancelIdle(c);
  if (c->f.fStatusTimeout && !c->f.fStatusTimeout.is_none())
    host::mainloop::timeout_remove(c->f.fStatusTimeout);
  om::destroy(c->f._fScanQueue);
}

void SuspendIdleScans(C *c) {
  c->f._fIdleScanSuspendCount += 1;
  call::CancelIdle(c);
}

void ResumeIdleScans(C *c) {
  c->f._fIdleScanSuspendCount -= 1;
  if (c->f._fIdleScanSuspendCount == 0 && !call::QueuesEmpty(c, false))
    call::ScheduleIdle(c);
}

void ScheduleIdle(C *c) {
  auto &f = c->f;
  if (f._fIdleScanSuspendCount != 0 || !(f._fIdleProcId.is_none() || !f._fIdleProcId))
    return;
  if (host::anamgr::PythonPathLength(f.fAnaMgr) == 0)
    return;
  Ref cb = py::getattr(self_of(c), PY_NAME("_CB_DoIdleAnalysis"));
  Ref prio = py::integer(f.fIdlePriority);
  f._fIdleProcId = host::mainloop::idle_add(cb, prio);
  om::emit(self_of(c), signal_name(0));
}

void CancelIdle(C *c) {
  auto &f = c->f;
  if (!f._fIdleProcId || f._fIdleProcId.is_none())
    return;
  Ref id = f._fIdleProcId;
  host::mainloop::idle_remove(id);
  f._fIdleProcId = Ref::none();
  om::emit(self_of(c), signal_name(1));
}

} // namespace scancoord::co
