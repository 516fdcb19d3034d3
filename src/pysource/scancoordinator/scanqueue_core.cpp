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

#include <structmember.h>

namespace scancoord::sq {

namespace om = host::orderedmap;

// ---- helpers -------------------------------------------------------------

Ref make_key(Q *q, Borrowed scope, Borrowed scan_name) {
  if (PyObject *shared = q->f.keys.find(scope.get(), scan_name.get()))
    return Ref::borrow(shared);
  Ref key = py::check(PyTuple_New(2));
  PyTuple_SET_ITEM(key.get(), 0, scope.ref().release());
  PyTuple_SET_ITEM(key.get(), 1, scan_name.ref().release());
  key = untrack_if_atomic(std::move(key));
  q->f.keys.add(scope.get(), scan_name.get(), key);
  return key;
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

// (scan count, location count) stored in _fPerScanNameCounts: read straight
// from the tuple when it is the pair of ints the queue stores.
// Returns whether the pair is such a tuple.
bool read_count_pair(Borrowed pair, long long &scans, long long &locs) {
  PyObject *p = pair.get();
  if (PyTuple_CheckExact(p) && PyTuple_GET_SIZE(p) == 2 &&
      PyLong_CheckExact(PyTuple_GET_ITEM(p, 0)) && PyLong_CheckExact(PyTuple_GET_ITEM(p, 1))) {
    scans = py::as_ll(Borrowed(PyTuple_GET_ITEM(p, 0)));
    locs = py::as_ll(Borrowed(PyTuple_GET_ITEM(p, 1)));
    return true;
  }
  Ref parts[2];
  unpack(pair, 2, parts);
  scans = py::as_ll(parts[0]);
  locs = py::as_ll(parts[1]);
  return false;
}

// Lookups in a dictionary with the key's hash computed once by the caller:
// a (scope, scan name) key is looked up and then stored or deleted, and
// hashing the tuple is most of a lookup's cost.
Ref get_kh(Borrowed d, Borrowed key, Py_hash_t hash) {
  PyObject *v = _PyDict_GetItem_KnownHash(d.get(), key.get(), hash);
  if (!v) {
    if (PyErr_Occurred())
      py::throw_error();
    return Ref();
  }
  return Ref::borrow(v);
}
void del_kh(Borrowed d, Borrowed key, Py_hash_t hash) {
  py::check_int(_PyDict_DelItem_KnownHash(d.get(), key.get(), hash));
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
  // defaultdict(int) as `d = defaultdict(); d.default_factory = int`: the
  // type's own new, then the factory stored through the type's member
  // descriptor, instead of a call that packs and parses an argument tuple.
  auto *type = reinterpret_cast<PyTypeObject *>(state->defaultdict.get());
  static PyMemberDef *factory = [type]() -> PyMemberDef * {
    PyObject *descr = PyDict_GetItemWithError(type->tp_dict, PY_NAME("default_factory").get());
    if (descr && Py_IS_TYPE(descr, &PyMemberDescr_Type))
      return reinterpret_cast<PyMemberDescrObject *>(descr)->d_member;
    PyErr_Clear();
    return nullptr;
  }();
  Ref d;
  if (factory && type->tp_new) {
    static Ref *no_args = new Ref(py::check(PyTuple_New(0)));
    d = py::check(type->tp_new(type, no_args->get(), nullptr));
    py::check_int(
        PyMember_SetOne(reinterpret_cast<char *>(d.get()), factory, state->int_type.get()));
  } else {
    d = py::call(state->defaultdict, state->int_type);
  }
  if (PyObject_GC_IsTracked(d.get()) && PyDict_GET_SIZE(d.get()) == 0)
    PyObject_GC_UnTrack(d.get());
  return d;
}

// _fPerScanNameCounts[scan_name] = (scans, locs).  When the stored pair is
// referenced by that dictionary alone (and the caller's `pair`), nobody can
// observe it, so its items are replaced in place instead of allocating a new
// tuple for every queued scan.
// `old` holds the values read from `pair` when read_count_pair found it to be
// a tuple of two ints (nothing runs between that read and this store).
struct CountPair {
  long long scans, locs;
};
void store_count_pair(Q *q, Borrowed scan_name, Ref &pair, long long scans, long long locs,
                      const CountPair *old) {
  if (old && Py_REFCNT(pair.get()) == 2) {
    PyObject *t = pair.get();
    // Each item is replaced only when its value changed (the location count
    // rarely does); a replaced item is released once the tuple is consistent.
    const long long values[2] = {scans, locs}, before[2] = {old->scans, old->locs};
    for (Py_ssize_t i = 0; i < 2; ++i) {
      if (values[i] == before[i])
        continue;
      Ref fresh = py::integer(values[i]);
      Ref replaced = Ref::steal(PyTuple_GET_ITEM(t, i));
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
  Ref table = q->f._fPerLocationInfo;
  Ref t = py::dict_get(table, loc);
  // The state read from: taken after the lookup, which may have run a
  // location's __eq__.
  info.table = table.get();
  info.version = py::dict_version(table);
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

bool LocInfo::current(const Q *q) const {
  return table && q->f._fPerLocationInfo.get() == table &&
         py::dict_version(Borrowed(table)) == version;
}

PyListObject *as_name_list(Borrowed v) {
  if (!PyList_Check(v.get())) {
    PyErr_Format(PyExc_TypeError, msg::kExpectedType, "list", Py_TYPE(v.get())->tp_name);
    py::throw_error();
  }
  return reinterpret_cast<PyListObject *>(v.get());
}

namespace {
bool gc_tracked(PyObject *o) { return PyObject_IS_GC(o) && PyObject_GC_IsTracked(o); }
} // namespace

Ref new_name_list(Borrowed name) {
  Ref l = py::check(PyList_New(1));
  PyList_SET_ITEM(l.get(), 0, name.ref().release());
  if (!gc_tracked(name.get()))
    PyObject_GC_UnTrack(l.get());
  return l;
}

void name_added(Borrowed list, Borrowed name) {
  if (gc_tracked(name.get()) && !PyObject_GC_IsTracked(list.get()))
    PyObject_GC_Track(list.get());
}

void untrack_name_list(Borrowed list) {
  if (!PyList_CheckExact(list.get()) || !PyObject_GC_IsTracked(list.get()))
    return;
  for (Py_ssize_t i = 0; i < PyList_GET_SIZE(list.get()); ++i)
    if (gc_tracked(PyList_GET_ITEM(list.get(), i)))
      return;
  PyObject_GC_UnTrack(list.get());
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
    Borrowed handler;
  } conns[] = {{&n.now_tree_branch_ready, PY_NAME("_CB_TreeBranchesNowReady")},
               {&n.inspect_failed, PY_NAME("_CB_InspectFailed")},
               {&n.cleared, PY_NAME("_CB_LocReadyCleared")}};
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
    Ref handler = py::getattr(self, PY_NAME("_CB_SingletonChanged"));
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
  Ref queues = q->f._fOrderedQueues;
  // An earlier answer stands while the scan name and priority are the same,
  // the order table is the same dictionary at the same version (the host may
  // change it in place), and the same single queue, with the same priority
  // and order, is still at the same place in the list.  Most calls ask again
  // for the single queue of a scan just handed out or queued (the idle loop
  // alternates between the primary and the secondary one).
  for (const auto &a : q->f.single_queue_answers) {
    if (a.queue && a.scan_name.get() == scan_name.get() && a.priority == priority &&
        a.orders.get() == orders.get() &&
        (!orders || !PyDict_Check(orders.get()) || py::dict_version(orders) == a.orders_version) &&
        a.queues.get() == queues.get() && a.index < PyList_GET_SIZE(queues.get()) &&
        PyList_GET_ITEM(queues.get(), a.index) == a.queue.get()) {
      const auto *sq = reinterpret_cast<SingleQueueObject *>(a.queue.get());
      if (sq->f.fPriority == priority && sq->f.fOrder == a.order)
        return a.queue;
    }
  }
  long long order = 0;
  // Taken before the lookup, which may run a scan name's __eq__.
  const uint64_t orders_version =
      orders && PyDict_Check(orders.get()) ? py::dict_version(orders) : 0;
  // A None table behaves as an empty one: every scan name has order 0.
  Ref found;
  if (orders && !orders.is_none())
    found = py::dict_get(orders, scan_name);
  if (state->debug && !found)
    write_scan_without_order(scan_name);
  if (found)
    order = as_int64(found);

  // A name without an order prints its diagnostic on every call, so its
  // answer is not kept.
  auto remember = [&](const Ref &sq, Py_ssize_t index) {
    if (state->debug && !found)
      return;
    auto &last = q->f.single_queue_answers[q->f.next_single_queue_answer];
    q->f.next_single_queue_answer =
        (q->f.next_single_queue_answer + 1) % ScanQueueFields::kSingleQueueAnswers;
    last.scan_name = scan_name.ref();
    last.priority = priority;
    last.order = order;
    last.orders = orders;
    last.orders_version = orders_version;
    last.queues = queues;
    last.index = index;
    last.queue = sq;
  };
  Py_ssize_t n = PyList_GET_SIZE(queues.get());
  Py_ssize_t insert_at = n;
  for (Py_ssize_t i = 0; i < n; ++i) {
    SingleQueueObject *sq = as_single_queue(PyList_GET_ITEM(queues.get(), i));
    if (sq->f.fPriority == priority && sq->f.fOrder == order) {
      Ref found_sq = Ref::borrow(reinterpret_cast<PyObject *>(sq));
      remember(found_sq, i);
      return found_sq;
    }
    if (sq->f.fPriority > priority || (sq->f.fPriority == priority && sq->f.fOrder > order)) {
      insert_at = i;
      break;
    }
  }
  Ref sq = new_single_queue(scan_name, priority, order);
  py::check_int(PyList_Insert(queues.get(), insert_at, sq.get()));
  remember(sq, insert_at);
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
    Ref k = key ? key.ref() : make_key(q, scope, scan_name);
    return py::dict_get(info.pending, k);
  }
  return find_waiting_priority(q, loc);
}

// ---- adding --------------------------------------------------------------

namespace {
void add_to_per_location_map(Q *q, Borrowed loc, Borrowed scan_name, Borrowed priority, Borrowed k,
                             Py_hash_t k_hash, LocInfo &info);
} // namespace

namespace {
// One pair of AddScanPairs: ready pairs are taken, the others parked.
// Returns whether the pair's location is ready.
bool ready_or_parked(Q *q, Borrowed loc, Borrowed scope, Borrowed scan_name, Borrowed prio,
                     bool add_to_check) {
  if (!q->f.fAnyAsyncInspectLocation && host::locations::IsAsyncInspectLocation(loc))
    q->f.fAnyAsyncInspectLocation = true;
  if (call::IsTreeBranchReady(q, loc))
    return true;
  Ref item = make_scan_item(loc, scope, scan_name, prio);
  Ref items = py::check(PyTuple_Pack(1, item.get()));
  AddItemsWaitingForInspect(q, loc, items);
  if (add_to_check)
    SetWholeFileCheckWaitingForInspect(q, loc, prio);
  return false;
}

bool sort_pair(Q *q, Borrowed pair, Borrowed scan_name, Borrowed prio, bool add_to_check, Ref *lp) {
  unpack_tuple(pair, 2, lp);
  return ready_or_parked(q, lp[0], lp[1], scan_name, prio, add_to_check);
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

void AddScanPair(Q *q, Borrowed loc, Borrowed scope, Borrowed scan_name, Borrowed priority,
                 bool add_to_check) {
  Ref prio = priority && !priority.is_none() ? priority.ref() : state->priorities[2];
  if (!ready_or_parked(q, loc, scope, scan_name, prio, add_to_check))
    return;
  const PairList one(loc, scope);
  call::AddReadyScanPairs(q, one, scan_name, prio, add_to_check);
}

void AddReadyScanPairs(Q *q, const PairList &pairs, Borrowed scan_name, Borrowed priority,
                       bool add_to_check) {
  const long long p = as_int64(priority);
  Ref prio = priority_obj(p);
  Ref sq_obj = call::GetSingleQueue(q, scan_name, p);
  SingleQueueObject *sq = as_single_queue(sq_obj.get());
  Ref uod = sq->f.fOrderedDict;
  Ref wild_key; // ('*', scan_name) and its hash, made on first use
  Py_hash_t wild_hash = -1;
  Ref visible = q->f._fVisibleDocLocs;
  Ref whole_files = q->f._fWholeFilesToCheck;
  const Borrowed wildcard = state->kWildcardScope;

  pairs.for_each([&](PairRef lp) {
    Borrowed loc = lp.first, scope = lp.second;
    Ref key = make_key(q, scope, scan_name);
    LocInfo info = loc_info(q, loc);
    // 1. already queued?  (The key's hash serves this lookup and the store.)
    Py_hash_t key_hash = -1;
    Ref existing;
    if (info) {
      key_hash = py::hash(key);
      existing = get_kh(info.pending, key, key_hash);
    } else {
      existing = find_waiting_priority(q, loc);
    }
    if (existing) {
      if (as_int64(existing) > p) {
        call::RemoveScanTriple(q, loc, scope, scan_name, existing, true, key, &info);
        info = loc_info(q, loc); // the removal may have dropped the entry
      } else {
        return;
      }
    }
    // 2. the whole file already queued at the same or a better priority?
    const bool scope_is_wild = is_wildcard(scope);
    if (!scope_is_wild) {
      if (!wild_key) {
        wild_key = make_key(q, wildcard, scan_name);
        wild_hash = py::hash(wild_key);
      }
      Ref whole = info ? get_kh(info.pending, wild_key, wild_hash) : find_waiting_priority(q, loc);
      if (whole && as_int64(whole) <= p)
        return;
    }
    // 3.-7. the single queue's name list
    const bool first = PySet_GET_SIZE(visible.get()) != 0 && py::set_contains(visible, loc);
    Ref name_list = om::get(uod, loc, first);
    if (!name_list) {
      om::set(uod, loc, new_name_list(scope), first);
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
        name_added(name_list, scope);
      }
    }
    // 8. bookkeeping; 9. the whole-file check
    add_to_per_location_map(q, loc, scan_name, prio, key, key_hash, info);
    if (add_to_check)
      py::dict_set(whole_files, loc, prio);
  });
}

namespace {
// _AddScanToPerLocationMap with the location's entry already looked up
// (empty when it has none); `k_hash` is the key's hash, or -1 when the
// caller has not computed it.
void add_to_per_location_map(Q *q, Borrowed loc, Borrowed scan_name, Borrowed priority, Borrowed k,
                             Py_hash_t k_hash, LocInfo &info) {
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
    if (k_hash == -1)
      k_hash = py::hash(k);
    py::check_int(_PyDict_SetItem_KnownHash(info.pending.get(), k.get(), priority.get(), k_hash));
  }

  Ref old = py::dict_get(info.counts, scan_name);
  const long long per_loc = (old ? py::as_ll(old) : 0) + 1;
  py::dict_set(info.counts, scan_name, py::integer(per_loc));

  long long scans = 0, locs = 0;
  Ref pair = py::dict_get(q->f._fPerScanNameCounts, scan_name);
  const bool exact = pair && read_count_pair(pair, scans, locs);
  const CountPair old_pair{scans, locs};
  scans += 1;
  if (per_loc == 1)
    locs += 1;
  if (state->debug && scans < locs)
    assertion_failed();
  store_count_pair(q, scan_name, pair, scans, locs, exact ? &old_pair : nullptr);
}
} // namespace

void AddScanToPerLocationMap(Q *q, Borrowed loc, Borrowed scope, Borrowed scan_name,
                             Borrowed priority, Borrowed key) {
  LocInfo info = loc_info(q, loc);
  Ref k = key ? key.ref() : make_key(q, scope, scan_name);
  add_to_per_location_map(q, loc, scan_name, priority, k, -1, info);
}

// ---- removing ------------------------------------------------------------

namespace {
// _RemoveScanFromPerLocationMap with the location's entry looked up and the
// key built: the key is hashed once for its lookup and its removal, and
// whether the scan name is still counted for the location is known from the
// count just updated rather than asked of the dictionary again.
bool remove_from_per_location_map(Q *q, Borrowed loc, Borrowed scan_name, Borrowed priority,
                                  Borrowed k, const LocInfo &info) {
  const Py_hash_t h = py::hash(k);
  Ref recorded = get_kh(info.pending, k, h);
  if (!recorded || !py::eq(recorded, priority))
    return false;
  // Removing the location's last scan drops its whole record.  When nothing
  // but the table and `info` holds the record and its two dictionaries,
  // nobody can see them again, so they are dropped as they are instead of
  // being emptied first.
  const bool unseen = PyDict_GET_SIZE(info.pending.get()) == 1 &&
                      PyTuple_CheckExact(info.tuple.get()) && Py_REFCNT(info.tuple.get()) == 2 &&
                      Py_REFCNT(info.pending.get()) == 2 && Py_REFCNT(info.counts.get()) == 2;
  if (!unseen)
    del_kh(info.pending, k, h);
  if (unseen || PyDict_GET_SIZE(info.pending.get()) == 0) {
    py::dict_del(q->f._fPerLocationInfo, loc);
    call::LocationRemoved(q, loc);
  }
  Ref old = py::dict_get(info.counts, scan_name);
  const long long per_loc = (old ? py::as_ll(old) : 0) - 1;
  if (per_loc == 0) {
    if (!unseen)
      py::dict_del(info.counts, scan_name);
  } else {
    py::dict_set(info.counts, scan_name, py::integer(per_loc));
  }

  Ref pair = py::dict_get(q->f._fPerScanNameCounts, scan_name);
  if (!pair) {
    if (state->debug)
      assertion_failed();
    return true;
  }
  long long scans = 0, locs = 0;
  const bool exact = read_count_pair(pair, scans, locs);
  const CountPair old_pair{scans, locs};
  scans -= 1;
  if (per_loc == 0)
    locs -= 1;
  if (scans == 0) {
    if (state->debug && locs != 0)
      assertion_failed();
    py::dict_del(q->f._fPerScanNameCounts, scan_name);
  } else {
    if (state->debug && scans < locs)
      assertion_failed();
    store_count_pair(q, scan_name, pair, scans, locs, exact ? &old_pair : nullptr);
  }
  return true;
}
} // namespace

bool RemoveScanFromPerLocationMap(Q *q, Borrowed loc, Borrowed scope, Borrowed scan_name,
                                  Borrowed priority, Borrowed key) {
  LocInfo info = loc_info(q, loc);
  if (!info)
    return false;
  Ref k = key ? key.ref() : make_key(q, scope, scan_name);
  return remove_from_per_location_map(q, loc, scan_name, priority, k, info);
}

namespace {

// Takes one scan out of the single queues and the per-location records.
bool remove_ready_scan(Q *q, Borrowed loc, Borrowed scope, Borrowed scan_name, Borrowed priority,
                       Borrowed key, const LocInfo *known);

} // namespace

bool RemoveScanTriple(Q *q, Borrowed loc, Borrowed scope, Borrowed scan_name, Borrowed priority,
                      bool remove_waiting, Borrowed key, const LocInfo *known) {
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
        static Ref *s_difference_update = new Ref(PY_NAME("difference_update"));
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
      const bool ready_removed = remove_ready_scan(q, loc, scope, scan_name, priority, key, known);
      return !to_remove.empty() || ready_removed;
    }
  }
  return remove_ready_scan(q, loc, scope, scan_name, priority, key, known);
}

namespace {

bool remove_ready_scan(Q *q, Borrowed loc, Borrowed scope, Borrowed scan_name, Borrowed priority,
                       Borrowed key, const LocInfo *known) {
  Ref prio;
  if (priority && !priority.is_none()) {
    prio = priority.ref();
  } else {
    prio = FindScanPriority(q, loc, scope, scan_name, key);
    if (!prio || prio.is_none())
      return false;
  }
  {
    // _RemoveScanFromPerLocationMap, with the caller's record when it is
    // still the one a lookup would find.
    LocInfo fresh;
    if (!known || !known->current(q)) {
      fresh = loc_info(q, loc);
      known = &fresh;
    }
    if (!*known)
      return false;
    Ref k = key ? key.ref() : make_key(q, scope, scan_name);
    if (!remove_from_per_location_map(q, loc, scan_name, prio, k, *known))
      return false;
  }
  Ref sq_obj = call::GetSingleQueue(q, scan_name, as_int64(prio));
  SingleQueueObject *sq = as_single_queue(sq_obj.get());
  Ref uod = sq->f.fOrderedDict;
  // A completed scan is usually of the location at the front of its queue.
  Ref name_list = om::get_likely_first(uod, loc);
  if (!name_list)
    return false;
  PyListObject *l = as_name_list(name_list);
  Py_ssize_t i = bisect_left(name_list, scope);
  if (i < PyList_GET_SIZE(l) && py::eq(Borrowed(PyList_GET_ITEM(l, i)), scope)) {
    // A list that only the mapping and we hold is dropped with its last name
    // still in it: nobody can see it again.
    if (PyList_GET_SIZE(l) == 1 && Py_REFCNT(name_list.get()) == 2) {
      om::del(uod, loc);
      return true;
    }
    py::check_int(PyList_SetSlice(name_list.get(), i, i + 1, nullptr));
    if (PyList_GET_SIZE(l) == 0)
      om::del(uod, loc);
    return true;
  }
  return false;
}

} // namespace

void RemoveAllForLocation(Q *q, Borrowed loc_b, Borrowed scan_name_set, bool remove_waiting) {
  const bool all_names = !scan_name_set || scan_name_set.is_none();
  Ref loc = loc_b.ref();
  bool kept = false;
  LocInfo info = loc_info(q, loc);
  if (info) {
    // Snapshot: RemoveScanTriple deletes from the pending dictionary.  A
    // location rarely has more than a few pending scans: they are copied to
    // the stack, a longer dictionary to the heap.
    constexpr Py_ssize_t kLocal = 4;
    std::pair<Ref, Ref> local[kLocal];
    std::vector<std::pair<Ref, Ref>> heap;
    const Py_ssize_t n = PyDict_GET_SIZE(info.pending.get());
    std::pair<Ref, Ref> *snapshot = local;
    if (n > kLocal) {
      heap.resize(static_cast<size_t>(n));
      snapshot = heap.data();
    }
    Py_ssize_t pos = 0, count = 0;
    PyObject *k, *v;
    while (count < n && PyDict_Next(info.pending.get(), &pos, &k, &v))
      snapshot[count++] = {Ref::borrow(k), Ref::borrow(v)};
    for (Py_ssize_t i = 0; i < count; ++i) {
      const auto &kv = snapshot[i];
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
        call::RemoveScanTriple(q, loc, parts[0], parts[1], kv.second, remove_waiting, kv.first,
                               &info);
      else
        kept = true;
    }
  }
  if (remove_waiting && !kept && PyDict_GET_SIZE(q->f._fWaitingForInspectByLoc.get()) != 0) {
    Ref waiting = q->f._fWaitingForInspectByLoc;
    Ref dropped = py::check(_PyDict_Pop(waiting.get(), loc.get(), Py_None));
  }
}

void RemoveAllForLocations(Q *q, Borrowed loc_seq, Borrowed scan_name_set, bool remove_waiting) {
  py::for_each(loc_seq,
               [&](Borrowed loc) { RemoveAllForLocation(q, loc, scan_name_set, remove_waiting); });
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

void ScanCompleted(Q *q, Borrowed scan_item, Borrowed key) {
  const ItemFields fields(scan_item);
  const Borrowed loc = fields[0], scope = fields[1], scan_name = fields[2], priority = fields[3];
  Ref done = make_scan_item(loc, scope, scan_name, Borrowed(Py_None));
  // Hashing the four-field record once serves the lookup and the store.
  Ref counts = q->f._fCompletedCount;
  const Py_hash_t h = py::hash(done);
  Ref old = get_kh(counts, done, h);
  Ref now = old ? py::check(PyNumber_Add(old.get(), state->one.get())) : state->one;
  py::check_int(_PyDict_SetItem_KnownHash(counts.get(), done.get(), now.get(), h));
  call::RemoveScanTriple(q, loc, scope, scan_name, priority, true, key);
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
