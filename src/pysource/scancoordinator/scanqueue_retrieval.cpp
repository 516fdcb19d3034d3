// _CScanQueue: which scan is handed out next, whole files due for a check,
// queries and counts, the promotion of the editor's active and visible
// documents, and the debug listing.
//
// Next-scan order: single queues in _fOrderedQueues order (priority, then
// scan order); within one, locations in the order of its ordered mapping;
// within a location, the first name of its sorted list.  First() never hands
// out a scan of a location whose data is not ready: such a location is parked
// and the walk starts again, which terminates because each retry removes one
// location from the single queues.
#include "pysource/scancoordinator/scanqueue.hpp"
#include "host/gui.hpp"
#include "host/hostmodules.hpp"
#include "host/mainloop.hpp"
#include "host/objectmodel.hpp"
#include "host/orderedmap.hpp"

namespace scancoord::sq {

namespace om = host::orderedmap;

Ref FirstOrNone(Q *q) {
  Ref queues = q->f._fOrderedQueues;
  for (Py_ssize_t i = 0; i < PyList_GET_SIZE(queues.get()); ++i) {
    Ref sq_obj = Ref::borrow(PyList_GET_ITEM(queues.get(), i));
    SingleQueueObject *sq = as_single_queue(sq_obj.get());
    Ref uod = sq->f.fOrderedDict;
    Ref loc, name_list;
    if (!om::first(uod, loc, name_list))
      continue;
    if (!call::IsTreeBranchReady(q, loc)) {
      call::MoveScansForLocToWaitingForInspect(q, loc, Borrowed());
      if (state->debug) {
        Ref loc2, list2;
        if (om::first(uod, loc2, list2) && loc2.get() == loc.get() &&
            list2.get() == name_list.get())
          assertion_failed();
      }
      return Ref();
    }
    PyListObject *l = as_name_list(name_list);
    if (PyList_GET_SIZE(l) == 0) {
      PyErr_SetString(PyExc_IndexError, "list index out of range");
      py::throw_error();
    }
    Ref scope = Ref::borrow(PyList_GET_ITEM(l, 0));
    Ref prio = priority_obj(sq->f.fPriority);
    Ref scan_name = sq->f.fScanName ? sq->f.fScanName : Ref::none();
    return make_scan_item(loc, scope, scan_name, prio);
  }
  return state->empty_item;
}

Ref First(Q *q) {
  for (;;) {
    Ref item = call::FirstOrNone(q);
    if (item)
      return item;
  }
}

Ref PopWholeFilesToCheck(Q *q, Py_ssize_t max_files) {
  Ref whole = q->f._fWholeFilesToCheck;
  if (PyDict_GET_SIZE(whole.get()) == 0)
    return Ref::none();
  // dict.popitem itself, called on the table (an exact dict: the field is
  // ours) without looking the method up for every file.
  static PyObject *popitem = [] {
    PyObject *m = PyDict_GetItemWithError(PyDict_Type.tp_dict, PY_NAME("popitem").get());
    if (!m && !PyErr_Occurred())
      PyErr_SetString(PyExc_SystemError, "dict.popitem not found");
    if (!m)
      py::throw_error();
    return m; // lives as long as the dict type
  }();
  Ref result = py::new_list();
  while (PyList_GET_SIZE(result.get()) <= max_files && PyDict_GET_SIZE(whole.get()) != 0)
    py::list_append(result, PyDict_CheckExact(whole.get())
                                ? py::call(Borrowed(popitem), whole)
                                : py::call_method(whole, PY_NAME("popitem")));
  if (!q->f.fAnyAsyncInspectLocation)
    return result;
  Ref ready = py::new_list();
  for (Py_ssize_t i = 0; i < PyList_GET_SIZE(result.get()); ++i) {
    Ref pair = Ref::borrow(PyList_GET_ITEM(result.get(), i));
    Ref parts[2];
    unpack(pair, 2, parts);
    if (call::IsTreeBranchReady(q, parts[0]))
      py::list_append(ready, pair);
    else
      call::MoveScansForLocToWaitingForInspect(q, parts[0], parts[1]);
  }
  return ready;
}

Ref GetPendingDictForLoc(Q *q, Borrowed loc) {
  LocInfo info = loc_info(q, loc);
  return info ? info.pending : Ref();
}

bool LocationInQueue(Q *q, Borrowed loc, Borrowed scan_name) {
  LocInfo info = loc_info(q, loc);
  if (!info)
    return false;
  if (!scan_name || scan_name.is_none())
    return true;
  return py::dict_contains(info.counts, scan_name);
}

bool Empty(Q *q, bool include_waiting) {
  auto &f = q->f;
  if (!include_waiting)
    return PyDict_GET_SIZE(f._fPerLocationInfo.get()) == 0;
  return PyDict_GET_SIZE(f._fPerLocationInfo.get()) == 0 &&
         PyDict_GET_SIZE(f._fWaitingForInspectByLoc.get()) == 0 &&
         PySet_GET_SIZE(f._fScanItemsWaitingForData.get()) == 0;
}

Py_ssize_t GetFileCount(Q *q, Borrowed scan_name, Borrowed priority) {
  Ref queues = q->f._fOrderedQueues;
  Py_ssize_t total = 0;
  for (Py_ssize_t i = 0; i < PyList_GET_SIZE(queues.get()); ++i) {
    Ref sq_obj = Ref::borrow(PyList_GET_ITEM(queues.get(), i));
    SingleQueueObject *sq = as_single_queue(sq_obj.get());
    if (priority && !priority.is_none() && !py::eq(py::integer(sq->f.fPriority), priority))
      continue;
    if (scan_name && !scan_name.is_none()) {
      Ref name = sq->f.fScanName ? sq->f.fScanName : Ref::none();
      if (!py::eq(name, scan_name))
        continue;
    }
    total += om::size(sq->f.fOrderedDict);
  }
  return total;
}

Ref GetScanCount(Q *q, Borrowed scan_item) {
  Ref item = scan_item.ref();
  Ref loc = item_field(item, 0), scope = item_field(item, 1), scan_name = item_field(item, 2);
  if (!item_field(item, 3).is_none())
    item = make_scan_item(loc, scope, scan_name, Borrowed(Py_None));
  Ref counts = q->f._fCompletedCount;
  Ref count = py::dict_get(counts, item);
  if (!count)
    count = py::integer(0);
  if (!py::eq(scope, state->kWildcardScope)) {
    Ref whole = make_scan_item(loc, state->kWildcardScope, scan_name, Borrowed(Py_None));
    Ref more = py::dict_get(counts, whole);
    if (more)
      count = py::check(PyNumber_Add(count.get(), more.get()));
  }
  return count;
}

Py_ssize_t GetWaitingCount(Q *q) {
  return PyDict_GET_SIZE(q->f._fWaitingForInspectByLoc.get()) +
         PySet_GET_SIZE(q->f._fScanItemsWaitingForData.get());
}

void UpdateForVisibleDocuments(Q *q, Borrowed active_loc, Borrowed visible_locs) {
  Ref visible = py::check(PySet_New(visible_locs.get()));
  Ref active = active_loc ? active_loc.ref() : Ref::none();
  if (!active.is_none())
    py::set_add(visible, active);
  if (py::eq(active, q->f._fActiveDocLoc) && py::eq(visible, q->f._fVisibleDocLocs))
    return;
  q->f._fActiveDocLoc = active;
  q->f._fVisibleDocLocs = visible;

  std::vector<Ref> locs{active};
  py::for_each(visible, [&](Borrowed loc) {
    if (!py::eq(loc, active))
      locs.push_back(loc.ref());
  });
  const long long interactive = kInteractivePriority;
  for (auto it = locs.rbegin(); it != locs.rend(); ++it) {
    const Ref &loc = *it;
    LocInfo info = loc_info(q, loc);
    if (!info)
      continue;
    // Handled (scan name, priority) pairs are tracked per location: one set
    // for the whole walk would leave the active document unpromoted whenever
    // another visible document has scans of the same name and priority.
    std::vector<std::pair<Ref, long long>> handled;
    std::vector<std::pair<Ref, Ref>> snapshot;
    Py_ssize_t pos = 0;
    PyObject *k, *v;
    while (PyDict_Next(info.pending.get(), &pos, &k, &v))
      snapshot.emplace_back(Ref::borrow(k), Ref::borrow(v));
    for (auto &kv : snapshot) {
      Ref parts[2];
      unpack(kv.first, 2, parts);
      const Ref &scan_name = parts[1];
      const long long prio = as_int64(kv.second);
      bool seen = false;
      for (auto &h : handled)
        if (h.second == prio && py::eq(h.first, scan_name)) {
          seen = true;
          break;
        }
      if (seen)
        continue;
      handled.emplace_back(scan_name, prio);
      Ref sq_obj = call::GetSingleQueue(q, scan_name, prio);
      if (prio <= interactive) {
        om::get(as_single_queue(sq_obj.get())->f.fOrderedDict, loc, true);
      } else {
        Ref to = call::GetSingleQueue(q, scan_name, interactive);
        MoveScansBetweenQueues(q, loc, Borrowed(Py_None), sq_obj, to);
      }
    }
  }
}

void MoveScansBetweenQueues(Q *q, Borrowed loc, Borrowed names_to_move, Borrowed from_queue,
                            Borrowed to_queue) {
  SingleQueueObject *from = as_single_queue(from_queue.get());
  SingleQueueObject *to = as_single_queue(to_queue.get());
  Ref to_name = to->f.fScanName ? to->f.fScanName : Ref::none();
  if (state->debug) {
    Ref from_name = from->f.fScanName ? from->f.fScanName : Ref::none();
    if (!py::eq(from_name, to_name))
      assertion_failed();
  }
  LocInfo info = loc_info(q, loc);
  if (!info)
    return;
  Ref names;
  if (!names_to_move || names_to_move.is_none()) {
    names = om::pop(from->f.fOrderedDict, loc);
    if (!names || PyObject_Size(names.get()) <= 0) {
      if (PyErr_Occurred())
        py::throw_error();
      return;
    }
  } else {
    // Only names found in the source list move; they leave it, and its
    // entry goes when it becomes empty.
    Ref source = om::get(from->f.fOrderedDict, loc);
    if (!source)
      return;
    as_name_list(source);
    names = py::new_list();
    py::for_each(names_to_move, [&](Borrowed name) {
      Py_ssize_t i = bisect_left(source, name);
      if (i < PyList_GET_SIZE(source.get()) &&
          py::eq(Borrowed(PyList_GET_ITEM(source.get(), i)), name)) {
        py::check_int(PyList_SetSlice(source.get(), i, i + 1, nullptr));
        py::list_append(names, name);
      }
    });
    if (PyList_GET_SIZE(source.get()) == 0)
      om::del(from->f.fOrderedDict, loc);
    if (PyList_GET_SIZE(names.get()) == 0)
      return;
    untrack_name_list(names);
  }
  as_name_list(names);
  Ref to_prio = priority_obj(to->f.fPriority);
  Ref target = om::get(to->f.fOrderedDict, loc, true);
  const Borrowed wildcard = state->kWildcardScope;
  if (!target || PyObject_Size(target.get()) == 0) {
    om::set(to->f.fOrderedDict, loc, names, true);
  } else {
    PyListObject *t = as_name_list(target);
    if (py::eq(Borrowed(PyList_GET_ITEM(t, 0)), wildcard)) {
      Ref from_prio = priority_obj(from->f.fPriority);
      for (Py_ssize_t i = 0; i < PyList_GET_SIZE(names.get()); ++i)
        RemoveScanFromPerLocationMap(q, loc, Borrowed(PyList_GET_ITEM(names.get(), i)), to_name,
                                     from_prio, Borrowed());
      return;
    }
    if (py::eq(Borrowed(PyList_GET_ITEM(names.get(), 0)), wildcard)) {
      Ref snapshot = py::check(PyList_GetSlice(target.get(), 0, PyList_GET_SIZE(t)));
      for (Py_ssize_t i = 0; i < PyList_GET_SIZE(snapshot.get()); ++i)
        RemoveScanFromPerLocationMap(q, loc, Borrowed(PyList_GET_ITEM(snapshot.get(), i)), to_name,
                                     to_prio, Borrowed());
      py::check_int(PyList_SetSlice(target.get(), 0, PyList_GET_SIZE(t), nullptr));
      py::list_append(target, wildcard);
    } else {
      for (Py_ssize_t i = 0; i < PyList_GET_SIZE(names.get()); ++i) {
        Ref name = Ref::borrow(PyList_GET_ITEM(names.get(), i));
        Py_ssize_t at = bisect_left(target, name);
        py::check_int(PyList_Insert(target.get(), at, name.get()));
        name_added(target, name);
      }
    }
  }
  for (Py_ssize_t i = 0; i < PyList_GET_SIZE(names.get()); ++i) {
    Ref key = make_key(q, Borrowed(PyList_GET_ITEM(names.get(), i)), to_name);
    py::dict_set(info.pending, key, to_prio);
  }
}

void CB_SingletonChanged(Q *q) {
  if (!q->f._fGuiMgr.is_none() && q->f._fGuiMgr)
    return;
  Ref gui = py::getattr(host::gui::GetSingletons(), host::names().fGuiMgr);
  q->f._fGuiMgr = gui;
  if (gui.is_none())
    return;
  Borrowed self(reinterpret_cast<PyObject *>(q));
  Ref handler = py::getattr(self, PY_NAME("_CB_ActiveDocChanged"));
  Ref cb = host::mainloop::NoArgCallback(handler);
  host::objectmodel::connect_while_alive(gui, host::names().active_document_changed, cb, self);
}

void CB_ActiveDocChanged(Q *q) {
  Ref gui = q->f._fGuiMgr;
  Ref loc = host::gui::ActiveSourceEditorLocation(gui);
  if (!loc)
    return;
  Ref visible = host::gui::VisibleDocuments(gui);
  UpdateForVisibleDocuments(q, loc, visible);
}

namespace {

void write_text(Borrowed write, Borrowed text) { py::call(write, text); }

void write_fmt(Borrowed write, const char *fmt, Borrowed a) {
  Ref s = py::check(PyUnicode_FromFormat(fmt, a.get()));
  write_text(write, s);
}

// "{}".format(x): the format protocol with an empty spec.
Ref fmt(Borrowed x) { return py::check(PyObject_Format(x.get(), nullptr)); }

Py_ssize_t write_for_loc(Borrowed write, Borrowed loc, Borrowed name_list, Py_ssize_t loc_limit) {
  write_fmt(write, "  %U\n", py::check(PyObject_Repr(loc.get())));
  Py_ssize_t count = 1;
  py::for_each_while(name_list, [&](Borrowed name) {
    if (count >= loc_limit) {
      write_text(write, PY_NAME("    ...\n"));
      return false;
    }
    write_fmt(write, "    %U\n", fmt(name));
    count += 1;
    return true;
  });
  return count;
}

} // namespace

void PrintScanQueues(Q *q, Borrowed write_arg, Py_ssize_t limit) {
  Ref write;
  if (!write_arg || write_arg.is_none())
    write = py::getattr(py::getattr(host::modules->sys, PY_NAME("stdout")), host::names().write);
  else
    write = write_arg.ref();
  write_text(write, PY_NAME("_CScanQueue contents:\n"));
  Py_ssize_t count = 0;
  Ref queues = py::check(
      PyList_GetSlice(q->f._fOrderedQueues.get(), 0, PyList_GET_SIZE(q->f._fOrderedQueues.get())));
  for (Py_ssize_t i = 0; i < PyList_GET_SIZE(queues.get()); ++i) {
    SingleQueueObject *sq = as_single_queue(PyList_GET_ITEM(queues.get(), i));
    Ref uod = sq->f.fOrderedDict;
    Ref scan_name = sq->f.fScanName ? sq->f.fScanName : Ref::none();
    Ref line =
        py::check(PyUnicode_FromFormat(" Scan queue for %U; priority=%lld count=%zd\n",
                                       fmt(scan_name).get(), sq->f.fPriority, om::size(uod)));
    write_text(write, line);
    if (count < limit) {
      py::for_each_while(om::items(uod), [&](Borrowed pair) {
        if (count >= limit) {
          write_text(write, PY_NAME("  ...\n"));
          return false;
        }
        Ref parts[2];
        unpack(pair, 2, parts);
        count += write_for_loc(write, parts[0], parts[1], limit - count);
        return true;
      });
    } else {
      write_text(write, PY_NAME("  ...\n"));
    }
  }
  Ref waiting = q->f._fWaitingForInspectByLoc;
  Py_ssize_t nwait = PyDict_GET_SIZE(waiting.get());
  if (nwait != 0) {
    Ref line =
        py::check(PyUnicode_FromFormat("Waiting for %zd remote files to be inspected", nwait));
    write_text(write, line);
    Ref keys = py::check(PyDict_Keys(waiting.get()));
    for (Py_ssize_t i = 0; i < PyList_GET_SIZE(keys.get()) && i < limit; ++i)
      write_fmt(write, "  File: %U\n", py::check(PyObject_Repr(PyList_GET_ITEM(keys.get(), i))));
    if (nwait >= limit)
      write_text(write, PY_NAME("  ...\n"));
  }
  Ref data = q->f._fScanItemsWaitingForData;
  Py_ssize_t ndata = PySet_GET_SIZE(data.get());
  if (ndata != 0) {
    Ref line = py::check(PyUnicode_FromFormat("Waiting for remote on %zd scans\n", ndata));
    write_text(write, line);
    Ref items = py::check(PySequence_List(data.get()));
    for (Py_ssize_t i = 0; i < PyList_GET_SIZE(items.get()) && i < limit; ++i)
      write_fmt(write, "  Scan: %U\n", py::check(PyObject_Repr(PyList_GET_ITEM(items.get(), i))));
    if (ndata >= limit)
      write_text(write, PY_NAME("  ...\n"));
  }
}

} // namespace scancoord::sq
