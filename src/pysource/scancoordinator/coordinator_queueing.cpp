// CScanCoordinator: the queueing interface.  Requests to scan pairs become
// scan-queue calls under the primary or the derived scan name (both read
// from the analysis manager at each call, never cached); whole-file primary
// work of local, unopened files may go to the helper process instead; every
// operation that hands pairs to the queue ends by scheduling the idle
// callback.
//
// Priority rule: an explicit priority is used as given; otherwise the active
// scan's priority while a scan runs, else interactive when `first` is true
// and background when it is not.
#include "pysource/scancoordinator/coordinator.hpp"
#include "pysource/scancoordinator/scanqueue.hpp"
#include "host/anamgr.hpp"
#include "host/cachemgr.hpp"
#include "host/gui.hpp"
#include "host/helperprocess.hpp"
#include "host/hostmodules.hpp"
#include "host/infocache.hpp"
#include "host/mainloop.hpp"
#include "host/objectmodel.hpp"

namespace scancoord::co {

namespace {

Ref resolve_priority(C *c, Borrowed first, Borrowed priority) {
  if (priority && !priority.is_none())
    return priority.ref();
  if (has(c->f.fActiveScanItem))
    return item_field(c->f.fActiveScanItem, 3);
  const bool f = first ? py::truth(first) : true;
  return state->priorities[f ? kInteractivePriority : kBackgroundPriority];
}

} // namespace

void AddPairsToPrimaryQueue(C *c, Borrowed pairs, Borrowed first, Borrowed priority) {
  Ref ana = c->f.fAnaMgr;
  Ref proxy = host::anamgr::HelperProcessProxy(ana);
  Ref to_add = pairs.ref();
  if (!proxy.is_none()) {
    Ref helper = py::new_list(), local = py::new_list();
    py::for_each(pairs, [&](Borrowed p) {
      Ref parts[2];
      unpack(p, 2, parts);
      py::list_append(call::CanSendToHelperProcess(c, parts[0], parts[1]) ? helper : local, p);
    });
    if (PyList_GET_SIZE(helper.get()) != 0) {
      for (Py_ssize_t i = 0; i < PyList_GET_SIZE(helper.get()); ++i) {
        Ref loc = py::check(PySequence_GetItem(PyList_GET_ITEM(helper.get(), i), 0));
        py::set_add(c->f._fLocsQueuedInHelper, loc);
      }
      host::helperprocess::AddPairsToPrimaryQueue(proxy, helper, first ? first : Borrowed(Py_True));
    }
    if (PyList_GET_SIZE(local.get()) == 0)
      return;
    to_add = local;
  }
  Ref prio = resolve_priority(c, first, priority);
  sq::AddScanPairs(queue(c), to_add, host::anamgr::PrimaryScanName(ana), prio, true);
  call::ScheduleIdle(c);
}

void AddPairsToSecondaryQueue(C *c, Borrowed pairs, Borrowed first, Borrowed priority) {
  Ref kept = py::new_list();
  py::for_each(pairs, [&](Borrowed p) {
    Ref parts[2];
    unpack(p, 2, parts);
    if (host::infocache::WantDerivedInfo(c->f._fInfoCache, parts[0]))
      py::list_append(kept, p);
  });
  if (PyList_GET_SIZE(kept.get()) == 0)
    return;
  Ref prio = resolve_priority(c, first, priority);
  sq::AddScanPairs(queue(c), kept, host::anamgr::DerivedScanName(c->f.fAnaMgr), prio, false);
  call::ScheduleIdle(c);
}

void AddPairToSecondaryQueue(C *c, Borrowed loc, Borrowed scope, Borrowed first,
                             Borrowed priority) {
  if (!host::infocache::WantDerivedInfo(c->f._fInfoCache, loc))
    return;
  Ref prio = resolve_priority(c, first, priority);
  sq::AddScanPair(queue(c), loc, scope, host::anamgr::DerivedScanName(c->f.fAnaMgr), prio, false);
  call::ScheduleIdle(c);
}

void AddNeedsScanSetToQueues(C *c, Borrowed needs_scan_set) {
  Ref primary = py::new_list(), secondary = py::new_list();
  py::for_each(needs_scan_set, [&](Borrowed triple) {
    Ref t[3];
    unpack(triple, 3, t);
    if (py::eq(t[2], host::anamgr::PrimaryScanName(c->f.fAnaMgr))) {
      Ref scope = t[1];
      if (!py::truth(host::cachemgr::DoesCacheBufferExist(c->f.fCacheMgr, t[0])))
        scope = state->kWildcardScope;
      py::list_append(primary, tuple_of(t[0], scope));
    } else if (py::eq(t[2], host::anamgr::DerivedScanName(c->f.fAnaMgr))) {
      py::list_append(secondary, tuple_of(t[0], t[1]));
    }
  });
  if (PyList_GET_SIZE(secondary.get()) != 0)
    call::AddPairsToSecondaryQueue(c, secondary, Borrowed(Py_True), Borrowed(Py_None));
  if (PyList_GET_SIZE(primary.get()) != 0)
    call::AddPairsToPrimaryQueue(c, primary, Borrowed(Py_True), Borrowed(Py_None));
}

void CB_NeedsScanAdded(C *c, Borrowed, Borrowed needs_scan_added, Borrowed priority) {
  Ref derived = host::anamgr::DerivedScanName(c->f.fAnaMgr);
  Ref needs = needs_scan_added.ref();
  Ref item = c->f.fActiveScanItem;
  if (has(item) && py::eq(item_field(item, 1), state->kWildcardScope) &&
      py::eq(item_field(item, 2), derived)) {
    Ref scanner = py::dict_get(c->f.fActiveSecondaryWholeFileScanners, item_field(item, 0));
    if (has(scanner))
      needs = py::call_method(scanner, PY_NAME("FilterNeedsScan"), needs);
  }
  Ref prio;
  if (priority && !priority.is_none())
    prio = priority.ref();
  else if (has(item))
    prio = item_field(item, 3);
  else
    prio = state->priorities[kInteractivePriority];
  // Grouped by scan name, in first-seen order.
  std::vector<std::pair<Ref, Ref>> groups;
  py::for_each(needs, [&](Borrowed triple) {
    Ref t[3];
    unpack(triple, 3, t);
    if (py::eq(t[2], derived) && !host::infocache::WantDerivedInfo(c->f._fInfoCache, t[0]))
      return;
    for (auto &g : groups)
      if (py::eq(g.first, t[2])) {
        py::list_append(g.second, tuple_of(t[0], t[1]));
        return;
      }
    groups.emplace_back(t[2], py::new_list());
    py::list_append(groups.back().second, tuple_of(t[0], t[1]));
  });
  for (auto &g : groups)
    sq::AddScanPairs(queue(c), g.second, g.first, prio, false);
  call::ScheduleIdle(c);
}

void CB_ActiveEditLinenoChanged(C *c, Borrowed ana, Borrowed new_lineno) {
  Ref loc = py::getattr(ana, host::names().fLocation);
  Ref incomplete = py::dict_get(c->f._fIncompleteScansByLoc, loc);
  if (!incomplete)
    return;
  Ref current = Ref::none();
  if (!py::eq(new_lineno, py::integer(-1)))
    current = py::call_method(ana, PY_NAME("FindScopeContainingLine"), new_lineno);
  Ref pairs = py::new_list();
  py::for_each(incomplete, [&](Borrowed scope) {
    int ne = PyObject_RichCompareBool(scope.get(), current.get(), Py_NE);
    if (ne < 0)
      py::throw_error();
    if (ne)
      py::list_append(pairs, tuple_of(loc, scope));
  });
  if (PyList_GET_SIZE(pairs.get()) == 0)
    return;
  Ref last = c->f._fLastScanCompleted;
  if (py::dict_contains(last, loc))
    py::dict_del(last, loc);
  call::AddPairsToPrimaryQueue(c, pairs, Borrowed(Py_True),
                               state->priorities[kInteractivePriority]);
}

void CB_QueueLocationsAdded(C *c, Borrowed, Borrowed) { call::ScheduleIdle(c); }

bool QueueBasicModules(C *c, Borrowed) {
  if (c->f._fAllBasicModuleQueued)
    return false;
  Ref factory = host::anamgr::AnalysisFactory(c->f.fAnaMgr);
  Ref builtin = py::call_method(factory, PY_NAME("FindBuiltinMod"));
  if (builtin.is_none())
    return false;
  Ref locs = py::new_list();
  {
    Ref name = py::getattr(builtin, PY_NAME("fLocalName"));
    Ref found = py::call_method(factory, PY_NAME("GetAllLocsForName"), name, Borrowed(Py_None),
                                Borrowed(Py_False));
    py::for_each(found, [&](Borrowed loc) { py::list_append(locs, loc); });
  }
  Ref typing = py::call_method(factory, PY_NAME("GetTypingLocations"));
  if (py::truth(typing))
    py::for_each(typing, [&](Borrowed loc) { py::list_append(locs, loc); });
  Ref pairs = py::new_list();
  for (Py_ssize_t i = 0; i < PyList_GET_SIZE(locs.get()); ++i)
    py::list_append(pairs, tuple_of(Borrowed(PyList_GET_ITEM(locs.get(), i)), PY_NAME("*")));
  call::AddPairsToPrimaryQueue(c, pairs, Borrowed(Py_True),
                               state->priorities[kTypingModulePriority]);
  c->f._fAllBasicModuleQueued = true;
  return false;
}

void AddParseablesToQueue(C *c, Borrowed loc_seq, Borrowed priority) {
  Ref mimes = py::new_dict();
  py::for_each(loc_seq, [&](Borrowed loc) { py::dict_set(mimes, loc, Borrowed(Py_None)); });
  Ref attrib_mgr = py::getattr(host::gui::GetSingletons(), PY_NAME("fFileAttribMgr"));
  py::call_method(attrib_mgr, PY_NAME("GetMultipleProbableMimeTypes"), mimes);
  Ref analysable = py::getattr(host::modules->mime, PY_NAME("kAnalyzableMimeTypes"));
  Ref pairs = py::new_list();
  Py_ssize_t pos = 0;
  PyObject *k, *v;
  std::vector<std::pair<Ref, Ref>> items;
  while (PyDict_Next(mimes.get(), &pos, &k, &v))
    items.emplace_back(Ref::borrow(k), Ref::borrow(v));
  for (auto &kv : items) {
    int in = PySequence_Contains(analysable.get(), kv.second.get());
    if (in < 0)
      py::throw_error();
    if (in)
      py::list_append(pairs, tuple_of(kv.first, state->kWildcardScope));
  }
  if (PyList_GET_SIZE(pairs.get()) == 0)
    return;
  call::AddPairsToPrimaryQueue(c, pairs, Borrowed(Py_True), priority);
}

bool QueuesEmpty(C *c, bool include_waiting) {
  if (!sq::Empty(queue(c), include_waiting))
    return false;
  return PySet_GET_SIZE(c->f._fLocsQueuedInHelper.get()) == 0;
}

bool LocationInPrimaryScanQueue(C *c, Borrowed loc) {
  return sq::LocationInQueue(queue(c), loc, host::anamgr::PrimaryScanName(c->f.fAnaMgr));
}

bool LocationInSecondaryScanQueue(C *c, Borrowed loc) {
  return sq::LocationInQueue(queue(c), loc, host::anamgr::DerivedScanName(c->f.fAnaMgr));
}

bool LocationInScanQueues(C *c, Borrowed loc) {
  return sq::LocationInQueue(queue(c), loc, Borrowed());
}

void RemoveLocationsFromQueue(C *c, Borrowed to_remove) {
  Ref locs = to_remove.ref();
  if (!PyAnySet_Check(locs.get()))
    locs = py::check(PyFrozenSet_New(locs.get()));
  sq::RemoveAllForLocations(queue(c), locs, Borrowed(), true);
}

void FlushQueue(C *c) {
  auto &f = c->f;
  if (has(f._fIdleProcId)) {
    Ref id = f._fIdleProcId;
    host::mainloop::idle_remove(id);
    f._fIdleProcId = Ref::none();
    host::objectmodel::emit(self_of(c), PY_NAME("end"));
  }
  sq::Clear(queue(c));
  PyDict_Clear(f._fLastScanCompleted.get());
  PyDict_Clear(f._fMTimeAtLastWholeFileCheck.get());
  f._fAllBasicModuleQueued = false;
  f.fWaitingForRemote = false;
  host::cachemgr::ClearEOLBlindCacheAndScans(py::getattr(f.fSingletons, PY_NAME("fCacheMgr")));
  py::check_int(PySet_Clear(f._fLocsQueuedInHelper.get()));
  Ref proxy = host::anamgr::HelperProcessProxy(f.fAnaMgr);
  if (!proxy.is_none())
    host::helperprocess::FlushQueue(proxy);
}

void ClearLastScanInfo(C *c, Borrowed loc_iterable) {
  Ref mtimes = c->f._fMTimeAtLastWholeFileCheck, last = c->f._fLastScanCompleted;
  py::for_each(loc_iterable, [&](Borrowed loc) {
    if (py::dict_contains(mtimes, loc))
      py::dict_del(mtimes, loc);
    if (py::dict_contains(last, loc))
      py::dict_del(last, loc);
  });
}

bool CanSendToHelperProcess(C *c, Borrowed loc, Borrowed scope_name) {
  if (!py::eq(scope_name, state->kWildcardScope))
    return false;
  Ref cls = py::getattr(host::modules->location, PY_NAME("CLocalFileLocation"));
  int is_local = PyObject_IsInstance(loc.get(), cls.get());
  if (is_local < 0)
    py::throw_error();
  if (!is_local)
    return false;
  return !py::truth(host::cachemgr::DoesCacheBufferExist(c->f.fCacheMgr, loc));
}

} // namespace scancoord::co
