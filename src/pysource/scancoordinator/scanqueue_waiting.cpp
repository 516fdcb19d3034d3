// _CScanQueue: holding areas for work whose data is not available, and the
// deferred "locations-added" / "locations-removed" signals.
//
//  - Waiting for inspection: _fWaitingForInspectByLoc maps a location to
//    (set of CScanItem, whole-file check priority or None).  The tuple is
//    replaced when the priority changes; the set inside it changes in place.
//  - Waiting for data: _fScanItemsWaitingForData holds items whose scanner
//    waits for remote data; they leave the queue and come back whole.
//  - Deferred signals: locations that gain their first or lose their last
//    ready scan are collected; one idle callback emits them.  Added then
//    removed within one period: in both sets; removed then added: in
//    neither.  The sets are handed over and replaced before emitting, so a
//    handler that changes the queue collects into fresh sets.
#include "pysource/scancoordinator/scanqueue.hpp"
#include "host/hostmodules.hpp"
#include "host/locations.hpp"
#include "host/mainloop.hpp"
#include "host/objectmodel.hpp"

namespace scancoord::sq {

bool IsTreeBranchReady(Q *q, Borrowed loc) {
  if (q->f.fAnyAsyncInspectLocation && host::locations::IsAsyncInspectLocation(loc))
    return host::locations::TreeBranchReady(q->f._fLocationDataCache, loc);
  return true;
}

void MoveScansForLocToWaitingForInspect(Q *q, Borrowed loc, Borrowed check_priority) {
  Ref pending = GetPendingDictForLoc(q, loc);
  if (!pending)
    return;
  Ref items = py::new_list();
  Py_ssize_t pos = 0;
  PyObject *k, *v;
  while (PyDict_Next(pending.get(), &pos, &k, &v)) {
    Ref key = Ref::borrow(k), prio = Ref::borrow(v);
    Ref parts[2];
    unpack(key, 2, parts);
    py::list_append(items, make_scan_item(loc, parts[0], parts[1], prio));
  }
  Ref check = check_priority ? check_priority.ref() : Ref();
  if (!check || check.is_none()) {
    check = py::dict_get(q->f._fWholeFilesToCheck, loc);
    if (!check)
      check = Ref::none();
  }
  RemoveAllForLocation(q, loc, Borrowed(), false);
  AddItemsWaitingForInspect(q, loc, items);
  SetWholeFileCheckWaitingForInspect(q, loc, check);
}

void AddItemsWaitingForInspect(Q *q, Borrowed loc, Borrowed item_seq) {
  Ref waiting = q->f._fWaitingForInspectByLoc;
  Ref entry = py::dict_get(waiting, loc);
  if (!entry) {
    Ref s = py::new_set();
    entry = py::check(PyTuple_Pack(2, s.get(), Py_None));
    py::dict_set(waiting, loc, entry);
  }
  Ref parts[2];
  unpack(entry, 2, parts);
  if (PyAnySet_Check(parts[0].get())) {
    py::for_each(item_seq, [&](Borrowed item) { py::set_add(parts[0], item); });
  } else {
    static Ref *s_update = new Ref(PY_NAME("update"));
    py::call_method(parts[0], *s_update, item_seq);
  }
}

void SetWholeFileCheckWaitingForInspect(Q *q, Borrowed loc, Borrowed check_priority) {
  Ref waiting = q->f._fWaitingForInspectByLoc;
  Ref entry = py::dict_get(waiting, loc);
  Ref item_set;
  if (entry) {
    Ref parts[2];
    unpack(entry, 2, parts);
    item_set = parts[0];
  } else {
    item_set = py::new_set();
  }
  Ref prio = check_priority ? check_priority.ref() : Ref::none();
  py::dict_set(waiting, loc, py::check(PyTuple_Pack(2, item_set.get(), prio.get())));
}

void CB_TreeBranchesNowReady(Q *q, Borrowed, Borrowed ready_set) {
  static Ref *s_intersection = new Ref(PY_NAME("intersection"));
  Ref waiting = q->f._fWaitingForInspectByLoc;
  Ref ready = py::call_method(ready_set, *s_intersection, waiting);
  if (!py::truth(ready))
    return;
  struct Group {
    Ref scan_name, priority;
    bool check;
    PairList pairs;
  };
  std::vector<Group> groups;
  py::for_each(ready, [&](Borrowed loc) {
    Ref entry = py::dict_get(waiting, loc);
    if (!entry)
      return;
    py::dict_del(waiting, loc);
    Ref parts[2];
    unpack(entry, 2, parts);
    const bool check = !parts[1].is_none();
    py::for_each(parts[0], [&](Borrowed item) {
      Ref scan_name = item_field(item, 2), prio = item_field(item, 3);
      Group *g = nullptr;
      for (auto &cand : groups)
        if (cand.check == check && py::eq(cand.scan_name, scan_name) &&
            py::eq(cand.priority, prio)) {
          g = &cand;
          break;
        }
      if (!g) {
        groups.push_back(Group{scan_name, prio, check, {}});
        g = &groups.back();
      }
      g->pairs.emplace_back(item_field(item, 0), item_field(item, 1));
    });
  });
  for (auto &g : groups)
    call::AddReadyScanPairs(q, g.pairs, g.scan_name, g.priority, g.check);
}

void StartWaitingForData(Q *q, Borrowed scan_item) {
  Ref waiting = q->f._fScanItemsWaitingForData;
  if (py::set_contains(waiting, scan_item))
    return;
  call::RemoveScanTriple(q, item_field(scan_item, 0), item_field(scan_item, 1),
                         item_field(scan_item, 2), item_field(scan_item, 3), true, Borrowed());
  py::set_add(waiting, scan_item);
}

void FinishedWaitingForData(Q *q, Borrowed scan_item) {
  Ref waiting = q->f._fScanItemsWaitingForData;
  if (!py::set_contains(waiting, scan_item))
    return;
  py::set_discard(waiting, scan_item);
  Ref pair =
      py::check(PyTuple_Pack(2, item_field(scan_item, 0).get(), item_field(scan_item, 1).get()));
  Ref seq = py::check(PyTuple_Pack(1, pair.get()));
  call::AddScanPairs(q, seq, item_field(scan_item, 2), item_field(scan_item, 3), false);
}

namespace {
void schedule_emission(Q *q) {
  if (q->f._fSignalEmitIdle && !q->f._fSignalEmitIdle.is_none())
    return;
  Ref cb = py::getattr(Borrowed(reinterpret_cast<PyObject *>(q)), PY_NAME("_SignalEmitIdle"));
  q->f._fSignalEmitIdle = host::mainloop::idle_add(cb);
}

void note_added(Q *q, Borrowed loc) {
  if (py::set_discard(q->f._fPendingLocationsRemoved, loc))
    return; // removed then re-added: in neither set
  py::set_add(q->f._fPendingLocationsAdded, loc);
}
} // namespace

void UpdatePendingSets(Q *q, Borrowed added_set, Borrowed removed_set) {
  if (added_set && !added_set.is_none()) {
    // Each location of the set either cancels a pending removal or is
    // recorded as added; iterating a snapshot keeps the caller's set intact.
    Ref snapshot = py::check(PySequence_List(added_set.get()));
    for (Py_ssize_t i = 0; i < PyList_GET_SIZE(snapshot.get()); ++i)
      note_added(q, Borrowed(PyList_GET_ITEM(snapshot.get(), i)));
  }
  if (removed_set && !removed_set.is_none())
    py::for_each(removed_set,
                 [&](Borrowed loc) { py::set_add(q->f._fPendingLocationsRemoved, loc); });
  schedule_emission(q);
}

void LocationAdded(Q *q, Borrowed loc) {
  note_added(q, loc);
  schedule_emission(q);
}

void LocationRemoved(Q *q, Borrowed loc) {
  py::set_add(q->f._fPendingLocationsRemoved, loc);
  schedule_emission(q);
}

void SignalEmitIdle(Q *q) {
  Ref added = q->f._fPendingLocationsAdded;
  q->f._fPendingLocationsAdded = py::new_set();
  Ref removed = q->f._fPendingLocationsRemoved;
  q->f._fPendingLocationsRemoved = py::new_set();
  q->f._fSignalEmitIdle = Ref::none();
  Borrowed self(reinterpret_cast<PyObject *>(q));
  if (PyObject_Size(added.get()) > 0)
    host::objectmodel::emit(self, host::names().locations_added, self, added);
  if (PyObject_Size(removed.get()) > 0)
    host::objectmodel::emit(self, host::names().locations_removed, self, removed);
}

} // namespace scancoord::sq
