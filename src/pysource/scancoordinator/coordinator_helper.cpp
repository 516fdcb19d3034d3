// CScanCoordinator: the helper process.
//
// Whole-file primary scans of local files without an open buffer may be
// scanned by a helper process, reached only through the analysis manager's
// proxy.  _UpdateForHelperProcess takes work back when the helper is gone,
// and when a new callback object appears hands the queued whole-file primary
// scans over (at the priority they had here) and connects the callback
// object's two signals once.  _fHelperCallbackObjConnected is set only after
// everything succeeded, so a failed hand-over is repeated by the next call.
// With a callback object but no proxy nothing is handed over (the work stays
// in the local queue); the signals are still connected.
#include "pysource/scancoordinator/coordinator.hpp"
#include "pysource/scancoordinator/scanqueue.hpp"
#include "host/anamgr.hpp"
#include "host/helperprocess.hpp"
#include "host/hostmodules.hpp"
#include "host/mainloop.hpp"
#include "host/orderedmap.hpp"

namespace scancoord::co {

namespace {

C *coord(PyObject *cell) { return reinterpret_cast<C *>(PyTuple_GET_ITEM(cell, 0)); }

PyObject *on_locs_removed(PyObject *cell, PyObject *locs){
    PY_GUARD(nullptr,
             {
               Ref queued = coord(cell)->f._fLocsQueuedInHelper;
               py::for_each(Borrowed(locs), [&](Borrowed loc) { py::set_discard(queued, loc); });
               Py_RETURN_NONE;
             })}

PyObject *on_locs_added(PyObject *cell, PyObject *locs){
    PY_GUARD(nullptr,
             {
               Ref queued = coord(cell)->f._fLocsQueuedInHelper;
               py::for_each(Borrowed(locs), [&](Borrowed loc) { py::set_add(queued, loc); });
               Py_RETURN_NONE;
             })}

PyMethodDef def_on_locs_removed = {
  "on_scan_queue_locs_removed",
  on_locs_removed,
  METH_O,
  nullptr
};
PyMethodDef def_on_locs_added = {"on_scan_queue_locs_added", on_locs_added, METH_O, nullptr};

Ref handler(PyMethodDef *def, Borrowed self) {
  Ref cell = py::check(PyTuple_Pack(1, self.get()));
  return host::mainloop::NoObjCallback(py::check(PyCFunction_NewEx(def, cell.get(), nullptr)));
}

} // namespace

void UpdateForHelperProcess(C *c) {
  auto &f = c->f;
  Borrowed self = self_of(c);
  Ref proxy = host::anamgr::HelperProcessProxy(f.fAnaMgr);
  // 1. no helper process: take its work back
  if (proxy.is_none() && PySet_GET_SIZE(f._fLocsQueuedInHelper.get()) != 0) {
    Ref pairs = py::new_list();
    py::for_each(f._fLocsQueuedInHelper, [&](Borrowed loc) {
      py::list_append(pairs, py::check(PyTuple_Pack(2, loc.get(), state->kWildcardScope.get())));
    });
    call::AddPairsToPrimaryQueue(c, pairs, Borrowed(Py_False), Borrowed(Py_None));
    py::check_int(PySet_Clear(f._fLocsQueuedInHelper.get()));
  }
  // 2.-3. the callback object
  Ref support = py::getattr(f.fAnaMgr, PY_NAME("_fHelperProcessSupport"));
  Ref callback_obj =
      support.is_none() ? Ref::none() : py::getattr(support, PY_NAME("fHelperCallbackObj"));
  if (callback_obj.is_none() || py::eq(callback_obj, or_none(f._fHelperCallbackObjConnected)))
    return;
  // 4. hand queued whole-file primary work over
  if (!proxy.is_none()) {
    ScanQueueObject *q = queue(c);
    Ref primary = host::anamgr::PrimaryScanName(f.fAnaMgr);
    Ref queues = py::check(PyList_GetSlice(q->f._fOrderedQueues.get(), 0,
                                           PyList_GET_SIZE(q->f._fOrderedQueues.get())));
    for (Py_ssize_t i = 0; i < PyList_GET_SIZE(queues.get()); ++i) {
      SingleQueueObject *sq = as_single_queue(PyList_GET_ITEM(queues.get(), i));
      Ref scan_name = or_none(sq->f.fScanName);
      if (!py::eq(scan_name, primary))
        continue;
      std::vector<Ref> collected;
      Ref items = host::orderedmap::items(sq->f.fOrderedDict);
      std::vector<std::pair<Ref, Ref>> entries;
      py::for_each(items, [&](Borrowed kv) {
        Ref parts[2];
        unpack(kv, 2, parts);
        entries.emplace_back(std::move(parts[0]), std::move(parts[1]));
      });
      for (auto &e : entries) {
        if (!PyList_Check(e.second.get()) || PyList_GET_SIZE(e.second.get()) != 1 ||
            !py::eq(Borrowed(PyList_GET_ITEM(e.second.get(), 0)), state->kWildcardScope))
          continue;
        if (call::CanSendToHelperProcess(c, e.first, state->kWildcardScope))
          collected.push_back(e.first);
      }
      Ref prio = py::integer(sq->f.fPriority);
      for (auto &loc : collected)
        sq::RemoveScanTriple(q, loc, state->kWildcardScope, scan_name, prio, true, Borrowed());
      if (!collected.empty()) {
        Ref pairs = py::new_list();
        for (auto &loc : collected)
          py::list_append(pairs,
                          py::check(PyTuple_Pack(2, loc.get(), state->kWildcardScope.get())));
        host::helperprocess::AddPairsToPrimaryQueueAt(proxy, pairs, prio);
      }
    }
  }
  // 5.-6. connect the two signals, class-wide, tied to this coordinator
  Ref removed = handler(&def_on_locs_removed, self);
  Ref added = handler(&def_on_locs_added, self);
  py::call_method(callback_obj, host::names().class_connect_while_alive,
                  PY_NAME("scan-queue-locs-removed"), removed, self);
  py::call_method(callback_obj, host::names().class_connect_while_alive,
                  PY_NAME("scan-queue-locs-added"), added, self);
  // 7.
  f._fHelperCallbackObjConnected = callback_obj;
}

} // namespace scancoord::co
