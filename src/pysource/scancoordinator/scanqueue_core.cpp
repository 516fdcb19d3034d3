// _CScanQueue: construction, the scan-order table, single queues, the
// per-location bookkeeping, adding and removing.
//
// Hot paths (adding, completing and removing scans) do no more than the
// dictionary and set operations the bookkeeping itself needs: the (scope,
// scan name) key is built once per scan and reused for every lookup, the
// location's (counts, pending) pair is looked up once where the steps would
// look it up twice, the deferred-signal sets are updated one location at a
// time without temporary sets, and records are built without calling through
// Python.  See scanqueue.hpp for the invariants.
#include "pysource/scancoordinator/scanqueue.hpp"
#include "host/hostmodules.hpp"
#include "host/gui.hpp"
#include "host/locations.hpp"
#include "host/mainloop.hpp"
#include "host/objectmodel.hpp"
#include "host/orderedmap.hpp"

namespace scancoord::sq {

namespace om = host::orderedmap;

// ---- helpers -------------------------------------------------------------

Ref make_key(Borrowed scope, Borrowed scan_name) {
  return untrack_if_atomic(py::check(PyTuple_Pack(2, scope.get(), scan_name.get())));
}

Ref priority_obj(long long p) {
  if (p >= 0 && p <= 2)
    return state->priorities[p];
  return py::integer(p);
}

namespace {

PyObject *require_dict(const Ref &o) {
  if (!PyDict_Check(o.get())) {
    PyErr_Format(PyExc_TypeError, msg::kExpectedType, "dict", Py_TYPE(o.get())->tp_name);
    py::throw_error();
  }
  return o.get();
}

bool is_wildcard(Borrowed scope) { return py::eq(scope, state->kWildcardScope); }

// (scan count, location count) stored in _fPerScanNameCounts.
void read_count_pair(Borrowed pair, long long &scans, long long &locs) {
  Ref parts[2];
  unpack(pair, 2, parts);
  scans = py::as_ll(parts[0]);
  locs = py::as_ll(parts[1]);
}

Ref make_count_pair(long long scans, long long locs) {
  Ref a = py::integer(scans), b = py::integer(locs);
  return untrack_if_atomic(py::check(PyTuple_Pack(2, a.get(), b.get())));
}

// A location's per-name counts: collections.defaultdict(int).  Like the
// collector does for plain dictionaries holding only atomic values, it starts
// untracked (its factory, int, and its str -> int entries can never be part
// of a cycle); storing a GC-tracked key or value re-tracks it, as for any
// dictionary.  Untracked, the (counts, pending) pair stays untracked too, so
// the queue's per-location records cost the cyclic GC nothing.
Ref new_counts_dict() {
  Ref d = py::call(state->defaultdict, state->int_type);
  if (PyObject_GC_IsTracked(d.get()) && PyDict_GET_SIZE(d.get()) == 0)
    PyObject_GC_UnTrack(d.get());
  return d;
}

// _fPerScanNameCounts[scan_name] = (scans, locs).  When the stored pair is
// referenced by that dictionary alone (and the caller's `pair`), nobody can
// observe it, so its items are replaced in place instead of allocating a new
// tuple for every queued scan.
void store_count_pair(Q *q, Borrowed scan_name, Ref &pair, long long scans, long long locs) {
  if (pair && PyTuple_CheckExact(pair.get()) && PyTuple_GET_SIZE(pair.get()) == 2 &&
      Py_REFCNT(pair.get()) == 2) {
    PyObject *t = pair.get();
    // Each item is replaced only when its value changed (the location count
    // rarely does); a replaced item is released once the tuple is consistent.
    const long long values[2] = {scans, locs};
    for (Py_ssize_t i = 0; i < 2; ++i) {
      PyObject *item = PyTuple_GET_ITEM(t, i);
      if (PyLong_CheckExact(item)) {
        const long long v = PyLong_AsLongLong(item);
        if (v == values[i])
          continue;
        PyErr_Clear(); // an out-of-range old value is simply replaced
      }
      Ref fresh = py::integer(values[i]);
      Ref old = Ref::steal(item);
      PyTuple_SET_ITEM(t, i, fresh.release());
    }
    return;
  }
  py::dict_set(q->f._fPerScanNameCounts, scan_name, make_count_pair(scans, locs));
}

void write_scan_without_order(Borrowed scan_name) {
  Ref text = py::check(PyUnicode_FromFormat("%s%S\n", msg::kScanWithoutOrder, scan_name.get()));
  PyObject *out = PySys_GetObject("stdout"); // borrowed
  if (!out || out == Py_None)
    return;
  Ref keep = Ref::borrow(out);
  py::check_int(PyFile_WriteObject(text.get(), keep.get(), Py_PRINT_RAW));
}

} // namespace

LocInfo loc_info(Q *q, Borrowed loc) {
  LocInfo info;
  Ref t = py::dict_get(q->f._fPerLocationInfo, loc);
  if (!t)
    return info;
  Ref parts[2];
  unpack_tuple(t, 2, parts);
  info.counts = std::move(parts[0]);
  info.pending = std::move(parts[1]);
  require_dict(info.counts);
  require_dict(info.pending);
  info.tuple = std::move(t);
  return info;
}

PyListObject *as_name_list(Borrowed v) {
  if (!PyList_Check(v.get())) {
    PyErr_Format(PyExc_TypeError, msg::kExpectedType, "list", Py_TYPE(v.get())->tp_name);
    py::throw_error();
  }
  return reinterpret_cast<PyListObject *>(v.get());
}

Py_ssize_t bisect_left(Borrowed list, Borrowed x) {
  Py_ssize_t lo = 0, hi = PyList_GET_SIZE(list.get());
  const bool x_str = PyUnicode_CheckExact(x.get());
  while (lo < hi) {
    Py_ssize_t mid = lo + (hi - lo) / 2;
    if (mid >= PyList_GET_SIZE(list.get())) {
      PyErr_SetString(PyExc_IndexError, "list index out of range");
      py::throw_error();
    }
    Ref item = Ref::borrow(PyList_GET_ITEM(list.get(), mid));
    int lt;
    if (x_str && PyUnicode_CheckExact(item.get())) {
      lt = PyUnicode_Compare(item.get(), x.get()) < 0;
      if (PyErr_Occurred())
        py::throw_error();
    } else {
      lt = PyObject_RichCompareBool(item.get(), x.get(), Py_LT);
      if (lt < 0)
        py::throw_error();
    }
    if (lt)
      lo = mid + 1;
    else
      hi = mid;
  }
  return lo;
}

// ---- construction --------------------------------------------------------

void init(Q *q, Borrowed location_data_cache) {
  static Ref *signals = new Ref(py::check(
      PyTuple_Pack(2, host::names().locations_added.get(), host::names().locations_removed.get())));
  Borrowed self(reinterpret_cast<PyObject *>(q));
  host::objectmodel::base_init(self, *signals);
  auto &f = q->f;
  f.fAnyAsyncInspectLocation = false;
  f._fScansToOrder = py::new_dict();
  f._fOrderedQueues = py::new_list();
  f._fPerLocationInfo = py::new_dict();
  f._fPerScanNameCounts = py::new_dict();
  f._fCompletedCount = py::call(state->defaultdict, state->int_type);
  f._fPendingLocationsAdded = py::new_set();
  f._fPendingLocationsRemoved = py::new_set();
  f._fSignalEmitIdle = Ref::none();
  f._fLocationDataCache = location_data_cache.ref();
  auto &n = host::names();
  struct {
    Ref *signal;
    const char *handler;
  } conns[] = {{&n.now_tree_branch_ready, "_CB_TreeBranchesNowReady"},
               {&n.inspect_failed, "_CB_InspectFailed"},
               {&n.cleared, "_CB_LocReadyCleared"}};
  for (auto &c : conns) {
    Ref handler = py::getattr(self, c.handler);
    host::objectmodel::connect_while_alive(location_data_cache, *c.signal, handler, self);
  }
  f._fWaitingForInspectByLoc = py::new_dict();
  f._fScanItemsWaitingForData = py::new_set();
  f._fActiveDocLoc = Ref::none();
  f._fVisibleDocLocs = py::new_set();
  f._fGuiMgr = Ref::none();
  {
    Ref singletons = host::gui::GetSingletons();
    Ref handler = py::getattr(self, "_CB_SingletonChanged");
    Ref cb = host::mainloop::NoArgCallback(handler);
    host::objectmodel::connect_while_alive(singletons, n.changed, cb, self);
  }
  f._fWholeFilesToCheck = py::new_dict();
  f.initialised = true;
}

void SetScansToOrder(Q *q, Borrowed scans_to_order) {
  if (!scans_to_order.is_none() && !PyDict_Check(scans_to_order.get())) {
    PyErr_Format(PyExc_TypeError, msg::kExpectedType, "dict",
                 Py_TYPE(scans_to_order.get())->tp_name);
    py::throw_error();
  }
  q->f._fScansToOrder = scans_to_order.ref();
}

Ref GetSingleQueue(Q *q, Borrowed scan_name, long long priority) {
  Ref orders = q->f._fScansToOrder;
  long long order = 0;
  // A None table behaves as an empty one: every scan name has order 0.
  Ref found;
  if (orders && !orders.is_none())
    found = py::dict_get(orders, scan_name);
  if (state->debug && !found)
    write_scan_without_order(scan_name);
  if (found)
    order = as_int64(found);

  Ref queues = q->f._fOrderedQueues;
  Py_ssize_t n = PyList_GET_SIZE(queues.get());
  Py_ssize_t insert_at = n;
  for (Py_ssize_t i = 0; i < n; ++i) {
    SingleQueueObject *sq = as_single_queue(PyList_GET_ITEM(queues.get(), i));
    if (sq->f.fPriority == priority && sq->f.fOrder == order)
      return Ref::borrow(reinterpret_cast<PyObject *>(sq));
    if (sq->f.fPriority > priority || (sq->f.fPriority == priority && sq->f.fOrder > order)) {
      insert_at = i;
      break;
    }
  }
  Ref sq = new_single_queue(scan_name, priority, order);
  py::check_int(PyList_Insert(queues.get(), insert_at, sq.get()));
  return sq;
}

namespace {
// The waiting-for-inspection half of _FindScanPriority, for a location that
// has no ready scans.
Ref find_waiting_priority(Q *q, Borrowed loc) {
  if (PyDict_GET_SIZE(q->f._fWaitingForInspectByLoc.get()) == 0)
    return Ref();
  Ref entry = py::dict_get(q->f._fWaitingForInspectByLoc, loc);
  if (!entry || entry.is_none())
    return Ref();
  Ref parts[2];
  unpack(entry, 2, parts);
  if (!parts[1].is_none())
    return parts[1];
  Ref item;
  py::for_each_while(parts[0], [&](Borrowed first) {
    item = first.ref();
    return false;
  });
  if (!item) {
    if (state->debug)
      assertion_failed(msg::kNotReached);
    return Ref();
  }
  return item_field(item, 3);
}
} // namespace

Ref FindScanPriority(Q *q, Borrowed loc, Borrowed scope, Borrowed scan_name, Borrowed key) {
  LocInfo info = loc_info(q, loc);
  if (info) {
    Ref k = key ? key.ref() : make_key(scope, scan_name);
    return py::dict_get(info.pending, k);
  }
  return find_waiting_priority(q, loc);
}

// ---- adding --------------------------------------------------------------

namespace {
void add_to_per_location_map(Q *q, Borrowed loc, Borrowed scan_name, Borrowed priority, Borrowed k,
                             LocInfo &info);
} // namespace

namespace {
// One pair of AddScanPairs: ready pairs are taken, the others parked.
// Returns whether the pair's location is ready.
bool sort_pair(Q *q, Borrowed pair, Borrowed scan_name, Borrowed prio, bool add_to_check, Ref *lp) {
  unpack_tuple(pair, 2, lp);
  if (!q->f.fAnyAsyncInspectLocation && host::locations::IsAsyncInspectLocation(lp[0]))
    q->f.fAnyAsyncInspectLocation = true;
  if (call::IsTreeBranchReady(q, lp[0]))
    return true;
  Ref item = make_scan_item(lp[0], lp[1], scan_name, prio);
  Ref items = py::check(PyTuple_Pack(1, item.get()));
  AddItemsWaitingForInspect(q, lp[0], items);
  if (add_to_check)
    SetWholeFileCheckWaitingForInspect(q, lp[0], prio);
  return false;
}
} // namespace

void AddScanPairs(Q *q, Borrowed pair_seq, Borrowed scan_name, Borrowed priority,
                  bool add_to_check) {
  Ref prio = priority && !priority.is_none() ? priority.ref() : state->priorities[2];
  // A list or tuple of pairs is read through a tuple (the list copied first,
  // so that host code run meanwhile cannot change what is being walked) and
  // the ready pairs are recorded as index runs; any other iterable is walked
  // once and its ready pairs kept.
  Ref snapshot;
  if (PyTuple_CheckExact(pair_seq.get()))
    snapshot = pair_seq.ref();
  else if (PyList_CheckExact(pair_seq.get()))
    snapshot = py::check(PyList_AsTuple(pair_seq.get()));
  PairList ready = snapshot ? PairList(snapshot) : PairList();
  try {
    Ref lp[2];
    if (snapshot) {
      const Py_ssize_t n = PyTuple_GET_SIZE(snapshot.get());
      for (Py_ssize_t i = 0; i < n; ++i)
        if (sort_pair(q, Borrowed(PyTuple_GET_ITEM(snapshot.get(), i)), scan_name, prio,
                      add_to_check, lp))
          ready.take(i);
    } else {
      py::for_each(pair_seq, [&](Borrowed pair) {
        if (sort_pair(q, pair, scan_name, prio, add_to_check, lp))
          ready.emplace_back(std::move(lp[0]), std::move(lp[1]));
      });
    }
  } catch (const py::PyError &) {
    // The pairs before the bad one are queued all the same.
    if (!ready.empty()) {
      PyObject *type, *value, *tb;
      PyErr_Fetch(&type, &value, &tb);
      try {
        call::AddReadyScanPairs(q, ready, scan_name, prio, add_to_check);
      } catch (const py::PyError &) {
        PyErr_Clear();
      }
      PyErr_Restore(type, value, tb);
    }
    throw;
  }
  if (ready.empty())
    return;
  call::AddReadyScanPairs(q, ready, scan_name, prio, add_to_check);
}

void AddReadyScanPairs(Q *q, const PairList &pairs, Borrowed scan_name, Borrowed priority,
                       bool add_to_check) {
  const long long p = as_int64(priority);
  Ref prio = priority_obj(p);
  Ref sq_obj = call::GetSingleQueue(q, scan_name, p);
  SingleQueueObject *sq = as_single_queue(sq_obj.get());
  Ref uod = sq->f.fOrderedDict;
  Ref wild_key; // ('*', scan_name), built on first use
  Ref visible = q->f._fVisibleDocLocs;
  Ref whole_files = q->f._fWholeFilesToCheck;
  const Borrowed wildcard = state->kWildcardScope;

  pairs.for_each([&](PairRef lp) {
    Borrowed loc = lp.first, scope = lp.second;
    Ref key = make_key(scope, scan_name);
    LocInfo info = loc_info(q, loc);
    // 1. already queued?
    Ref existing = info ? py::dict_get(info.pending, key) : find_waiting_priority(q, loc);
    if (existing) {
      if (as_int64(existing) > p) {
        call::RemoveScanTriple(q, loc, scope, scan_name, existing, true, key);
        info = loc_info(q, loc); // the removal may have dropped the entry
      } else {
        return;
      }
    }
    // 2. the whole file already queued at the same or a better priority?
    const bool scope_is_wild = is_wildcard(scope);
    if (!scope_is_wild) {
      if (!wild_key)
        wild_key = make_key(wildcard, scan_name);
      Ref whole = info ? py::dict_get(info.pending, wild_key) : find_waiting_priority(q, loc);
      if (whole && as_int64(whole) <= p)
        return;
    }
    // 3.-7. the single queue's name list
    const bool first = PySet_GET_SIZE(visible.get()) != 0 && py::set_contains(visible, loc);
    Ref name_list = om::get(uod, loc, first);
    if (!name_list) {
      Ref l = py::check(PyList_New(1));
      PyList_SET_ITEM(l.get(), 0, scope.ref().release());
      om::set(uod, loc, l, first);
    } else {
      PyListObject *l = as_name_list(name_list);
      if (PyList_GET_SIZE(l) == 0) {
        PyErr_SetString(PyExc_IndexError, "list index out of range");
        py::throw_error();
      }
      if (py::eq(Borrowed(PyList_GET_ITEM(l, 0)), wildcard))
        return;
      if (scope_is_wild) {
        for (Py_ssize_t i = 0; i < PyList_GET_SIZE(l); ++i) {
          Ref name = Ref::borrow(PyList_GET_ITEM(l, i));
          RemoveScanFromPerLocationMap(q, loc, name, scan_name, prio, Borrowed());
        }
        Ref only = py::check(PyList_New(1));
        PyList_SET_ITEM(only.get(), 0, wildcard.ref().release());
        py::check_int(PyList_SetSlice(name_list.get(), 0, PyList_GET_SIZE(l), only.get()));
        info = loc_info(q, loc);
      } else {
        Py_ssize_t i = bisect_left(name_list, scope);
        Py_ssize_t n = PyList_GET_SIZE(l);
        if (i < n && !py::eq(Borrowed(PyList_GET_ITEM(l, i)), scope))
          py::check_int(PyList_Insert(name_list.get(), i, scope.get()));
        else if (i == n)
          py::list_append(name_list, scope);
        else
          return;
      }
    }
    // 8. bookkeeping; 9. the whole-file check
    add_to_per_location_map(q, loc, scan_name, prio, key, info);
    if (add_to_check)
      py::dict_set(whole_files, loc, prio);
  });
}

namespace {
// _AddScanToPerLocationMap with the location's entry already looked up
// (empty when it has none).
void add_to_per_location_map(Q *q, Borrowed loc, Borrowed scan_name, Borrowed priority, Borrowed k,
                             LocInfo &info) {
  if (!info) {
    info.counts = new_counts_dict();
    info.pending = py::new_dict();
    info.tuple =
        untrack_if_atomic(py::check(PyTuple_Pack(2, info.counts.get(), info.pending.get())));
    py::dict_set(q->f._fPerLocationInfo, loc, info.tuple);
    call::LocationAdded(q, loc);
  }
  if (state->debug) {
    // One lookup for both the invariant check and the store.
    PyObject *stored = PyDict_SetDefault(info.pending.get(), k.get(), priority.get());
    if (!stored)
      py::throw_error();
    if (stored != priority.get())
      assertion_failed();
  } else {
    py::dict_set(info.pending, k, priority);
  }

  Ref old = py::dict_get(info.counts, scan_name);
  const long long per_loc = (old ? py::as_ll(old) : 0) + 1;
  py::dict_set(info.counts, scan_name, py::integer(per_loc));

  long long scans = 0, locs = 0;
  Ref pair = py::dict_get(q->f._fPerScanNameCounts, scan_name);
  if (pair)
    read_count_pair(pair, scans, locs);
  scans += 1;
  if (per_loc == 1)
    locs += 1;
  if (state->debug && scans < locs)
    assertion_failed();
  store_count_pair(q, scan_name, pair, scans, locs);
}
} // namespace

void AddScanToPerLocationMap(Q *q, Borrowed loc, Borrowed scope, Borrowed scan_name,
                             Borrowed priority, Borrowed key) {
  LocInfo info = loc_info(q, loc);
  Ref k = key ? key.ref() : make_key(scope, scan_name);
  add_to_per_location_map(q, loc, scan_name, priority, k, info);
}

// ---- removing ------------------------------------------------------------

bool RemoveScanFromPerLocationMap(Q *q, Borrowed loc, Borrowed scope, Borrowed scan_name,
                                  Borrowed priority, Borrowed key) {
  LocInfo info = loc_info(q, loc);
  if (!info)
    return false;
  Ref k = key ? key.ref() : make_key(scope, scan_name);
  Ref recorded = py::dict_get(info.pending, k);
  if (!recorded || !py::eq(recorded, priority))
    return false;
  py::dict_del(info.pending, k);
  if (PyDict_GET_SIZE(info.pending.get()) == 0) {
    py::dict_del(q->f._fPerLocationInfo, loc);
    call::LocationRemoved(q, loc);
  }
  Ref old = py::dict_get(info.counts, scan_name);
  const long long per_loc = (old ? py::as_ll(old) : 0) - 1;
  if (per_loc == 0)
    py::dict_del(info.counts, scan_name);
  else
    py::dict_set(info.counts, scan_name, py::integer(per_loc));

  Ref pair = py::dict_get(q->f._fPerScanNameCounts, scan_name);
  if (!pair) {
    if (state->debug)
      assertion_failed();
    return true;
  }
  long long scans = 0, locs = 0;
  read_count_pair(pair, scans, locs);
  scans -= 1;
  if (!py::dict_contains(info.counts, scan_name))
    locs -= 1;
  if (scans == 0) {
    if (state->debug && locs != 0)
      assertion_failed();
    py::dict_del(q->f._fPerScanNameCounts, scan_name);
  } else {
    if (state->debug && scans < locs)
      assertion_failed();
    store_count_pair(q, scan_name, pair, scans, locs);
  }
  return true;
}

namespace {

// Takes one scan out of the single queues and the per-location records.
bool remove_ready_scan(Q *q, Borrowed loc, Borrowed scope, Borrowed scan_name, Borrowed priority,
                       Borrowed key);

} // namespace

bool RemoveScanTriple(Q *q, Borrowed loc, Borrowed scope, Borrowed scan_name, Borrowed priority,
                      bool remove_waiting, Borrowed key) {
  Ref waiting = q->f._fWaitingForInspectByLoc;
  if (remove_waiting && PyDict_GET_SIZE(waiting.get()) != 0) {
    Ref entry = py::dict_get(waiting, loc);
    if (entry) {
      Ref parts[2];
      unpack(entry, 2, parts);
      Ref item_set = parts[0];
      std::vector<Ref> to_remove;
      if (priority && !priority.is_none()) {
        to_remove.push_back(make_scan_item(loc, scope, scan_name, priority));
      } else {
        py::for_each(item_set, [&](Borrowed item) {
          if (py::eq(item_field(item, 1), scope) && py::eq(item_field(item, 2), scan_name))
            to_remove.push_back(item.ref());
        });
      }
      // set.difference_update, not one discard per item: it also compacts a
      // table left with many dummies, and that decides the set's later
      // iteration order (which decides the order parked work is re-queued).
      {
        Ref removal = py::new_list();
        for (auto &item : to_remove)
          py::list_append(removal, item);
        static Ref *s_difference_update = new Ref(py::interned("difference_update"));
        py::call_method(item_set, *s_difference_update, removal);
      }
      if (PyObject_Size(item_set.get()) == 0) {
        if (PyErr_Occurred())
          py::throw_error();
        Ref popped = py::check(PyObject_CallMethod(waiting.get(), "pop", "OO", loc.get(), Py_None));
      }
      // A location with parked work may also have ready scans (queued after
      // its branch became ready, or resumed after waiting for data): the
      // matching one leaves the ready queue too, the parked work stays.
      const bool ready_removed = remove_ready_scan(q, loc, scope, scan_name, priority, key);
      return !to_remove.empty() || ready_removed;
    }
  }
  return remove_ready_scan(q, loc, scope, scan_name, priority, key);
}

namespace {

bool remove_ready_scan(Q *q, Borrowed loc, Borrowed scope, Borrowed scan_name, Borrowed priority,
                       Borrowed key) {
  Ref prio;
  if (priority && !priority.is_none()) {
    prio = priority.ref();
  } else {
    prio = FindScanPriority(q, loc, scope, scan_name, key);
    if (!prio || prio.is_none())
      return false;
  }
  if (!RemoveScanFromPerLocationMap(q, loc, scope, scan_name, prio, key))
    return false;
  Ref sq_obj = call::GetSingleQueue(q, scan_name, as_int64(prio));
  SingleQueueObject *sq = as_single_queue(sq_obj.get());
  Ref uod = sq->f.fOrderedDict;
  Ref name_list = om::get(uod, loc);
  if (!name_list)
    return false;
  PyListObject *l = as_name_list(name_list);
  Py_ssize_t i = bisect_left(name_list, scope);
  if (i < PyList_GET_SIZE(l) && py::eq(Borrowed(PyList_GET_ITEM(l, i)), scope)) {
    py::check_int(PyList_SetSlice(name_list.get(), i, i + 1, nullptr));
    if (PyList_GET_SIZE(l) == 0)
      om::del(uod, loc);
    return true;
  }
  return false;
}

} // namespace

void RemoveAllForLocations(Q *q, Borrowed loc_seq, Borrowed scan_name_set, bool remove_waiting) {
  const bool all_names = !scan_name_set || scan_name_set.is_none();
  py::for_each(loc_seq, [&](Borrowed loc_b) {
    Ref loc = loc_b.ref();
    bool kept = false;
    LocInfo info = loc_info(q, loc);
    if (info) {
      // Snapshot: RemoveScanTriple deletes from the pending dictionary.
      std::vector<std::pair<Ref, Ref>> snapshot;
      snapshot.reserve(static_cast<size_t>(PyDict_GET_SIZE(info.pending.get())));
      Py_ssize_t pos = 0;
      PyObject *k, *v;
      while (PyDict_Next(info.pending.get(), &pos, &k, &v))
        snapshot.emplace_back(Ref::borrow(k), Ref::borrow(v));
      for (auto &kv : snapshot) {
        Ref parts[2];
        unpack(kv.first, 2, parts);
        bool take = all_names;
        if (!take) {
          int r = PySequence_Contains(scan_name_set.get(), parts[1].get());
          if (r < 0)
            py::throw_error();
          take = r != 0;
        }
        if (take)
          call::RemoveScanTriple(q, loc, parts[0], parts[1], kv.second, remove_waiting, kv.first);
        else
          kept = true;
      }
    }
    if (remove_waiting && !kept && PyDict_GET_SIZE(q->f._fWaitingForInspectByLoc.get()) != 0) {
      Ref waiting = q->f._fWaitingForInspectByLoc;
      if (py::dict_contains(waiting, loc))
        py::dict_del(waiting, loc);
    }
  });
}

void Clear(Q *q) {
  auto &f = q->f;
  Ref removed = py::check(PySet_New(f._fPerLocationInfo.get()));
  Ref queues = f._fOrderedQueues;
  Ref snapshot = py::check(PyList_GetSlice(queues.get(), 0, PyList_GET_SIZE(queues.get())));
  for (Py_ssize_t i = 0; i < PyList_GET_SIZE(snapshot.get()); ++i)
    host::objectmodel::destroy(Borrowed(PyList_GET_ITEM(snapshot.get(), i)));
  f._fOrderedQueues = py::new_list();
  PyDict_Clear(f._fPerLocationInfo.get());
  PyDict_Clear(f._fPerScanNameCounts.get());
  PyDict_Clear(f._fWaitingForInspectByLoc.get());
  PyDict_Clear(f._fCompletedCount.get());
  PyDict_Clear(f._fWholeFilesToCheck.get());
  call::UpdatePendingSets(q, Borrowed(), removed);
  f.fAnyAsyncInspectLocation = false;
}

void ScanCompleted(Q *q, Borrowed scan_item) {
  Ref loc = item_field(scan_item, 0), scope = item_field(scan_item, 1),
      scan_name = item_field(scan_item, 2), priority = item_field(scan_item, 3);
  Ref key = make_scan_item(loc, scope, scan_name, Borrowed(Py_None));
  Ref counts = q->f._fCompletedCount;
  Ref old = py::dict_get(counts, key);
  Ref one = py::integer(1);
  Ref now = old ? py::check(PyNumber_Add(old.get(), one.get())) : one;
  py::dict_set(counts, key, now);
  call::RemoveScanTriple(q, loc, scope, scan_name, priority, true, Borrowed());
}

void destroy_impl(Q *q) {
  if (!q->f.initialised)
    return;
  call::Clear(q);
  Ref idle = q->f._fSignalEmitIdle;
  if (idle && !idle.is_none()) {
    host::mainloop::idle_remove(idle);
    q->f._fSignalEmitIdle = Ref::none(); // a cancelled callback's id is not kept
  }
}

} // namespace scancoord::sq
