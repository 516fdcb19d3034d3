// CScanCoordinator: the idle analysis loop.
//
// Each idle call runs one slice with a time budget (0.05 s; 0.1 s when the
// interpreter runs without -O and the inference engine is uncompiled
// source): it makes sure the status timeout runs, queues the basic modules
// once, checks whole files in batches, then takes scans from the front of
// the queue one at a time.  A scan that does not finish ends the slice and
// keeps its item queued; a finished one is recorded as completed.  The
// callback returns True while scans remain, False when the queue is empty;
// any exception is logged, reported to the host and (without -O) re-raised,
// with _fIdleProcId cleared so that the next _ScheduleIdle resumes work.
#include "pysource/scancoordinator/coordinator.hpp"
#include "pysource/scancoordinator/scanqueue.hpp"
#include "host/anamgr.hpp"
#include "host/hostmodules.hpp"
#include "host/infocache.hpp"
#include "host/objectmodel.hpp"

#include <chrono>

namespace scancoord::co {

namespace msgs {
constexpr const char *kEntering = "Entering _CB_DoIdleAnalysis()";
constexpr const char *kQuitting =
    "Returning False from _CB_DoIdleAnalysis because Ostrel in quitting";
constexpr const char *kEmpty = "Returning False from _CB_DoIdleAnalysis() because scan queue is "
                               "empty (not including waiting)";
constexpr const char *kNotEmpty =
    "Returning True from _CB_DoIdleAnalysis() because scan queue is not empty";
constexpr const char *kException =
    "Exception raised in _CB_DoIdleAnalysis(); implicitly returning None";
constexpr const char *kOutOfTime = "Out of time after whole file check";
constexpr const char *kLocIsNone = "loc is None in scan_item";
constexpr const char *kTooRecent = "Skipping scan because last scan is too recent: %r";
constexpr const char *kNotPython = "Removing scan because not python: %r";
constexpr const char *kChecking = "Checking whole files: %r";
constexpr const char *kScansDone = "__CheckWholeFiles scans_done_dict: %r";
} // namespace msgs

double now_time() {
  using namespace std::chrono;
  return duration<double>(system_clock::now().time_since_epoch()).count();
}

void log(C *c, Borrowed message) { py::call(c->f.fLog, message); }
void log(C *c, Borrowed format, Borrowed value) { py::call(c->f.fLog, format, value); }

namespace {

bool logging_on(C *c) {
  static Ref *s_out = new Ref(PY_NAME("fOutputFile"));
  return !py::getattr(c->f.fLog, *s_out).is_none();
}

double slice_budget() {
  if (!state->debug)
    return 0.05;
  Ref file = py::Ref::steal(
      PyObject_GetAttr(host::modules->inferenceengine.get(), PY_NAME("__file__").get()));
  if (!file) {
    PyErr_Clear();
    return 0.1;
  }
  if (!PyUnicode_Check(file.get()))
    return 0.1;
  static Ref *so = new Ref(PY_NAME(".so")), *pyd = new Ref(PY_NAME(".pyd"));
  for (Ref *suffix : {so, pyd}) {
    Py_ssize_t r = PyUnicode_Tailmatch(file.get(), suffix->get(), 0, PY_SSIZE_T_MAX, 1);
    if (r < 0)
      py::throw_error();
    if (r)
      return 0.05;
  }
  return 0.1;
}

bool is_python(C *c, Borrowed loc) {
  if (loc.get() == c->f.fActiveLoc.get())
    return true;
  Ref url = py::getattr(loc, PY_NAME("fUrl"));
  if (PyUnicode_Check(url.get())) {
    for (Borrowed suffix : {PY_NAME(".py"), PY_NAME(".pi"), PY_NAME(".pyi")}) {
      Py_ssize_t r = PyUnicode_Tailmatch(url.get(), suffix.get(), 0, PY_SSIZE_T_MAX, 1);
      if (r < 0)
        py::throw_error();
      if (r)
        return true;
    }
  } else {
    static Ref *s_endswith = new Ref(PY_NAME("endswith"));
    Ref suffixes = py::check(Py_BuildValue("(sss)", ".py", ".pi", ".pyi"));
    if (py::truth(py::call_method(url, *s_endswith, suffixes)))
      return true;
  }
  Ref is_src = py::call(host::attr(host::Attr::IsPythonSource), loc);
  if (py::truth(is_src))
    return true;
  return has(call::GetAnalysis(c, loc, true));
}

// The exception being handled, made visible to sys.exc_info() while the host's
// reporting function runs.
void report_current_exception(Borrowed exc) {
  PyObject *previous = PyErr_GetHandledException();
  PyErr_SetHandledException(exc.get());
  Ref report =
      Ref::steal(PyObject_GetAttrString(host::modules->reflect.get(), "ReportCurrentException"));
  Ref result = report ? Ref::steal(PyObject_CallNoArgs(report.get())) : Ref();
  PyErr_SetHandledException(previous);
  Py_XDECREF(previous);
  if (!result)
    py::throw_error();
}

} // namespace

PyObject *CB_DoIdleAnalysis(C *c) {
  auto &f = c->f;
  // Host module attributes are read once for the whole slice.
  host::Snapshot snapshot;
  const double budget = slice_budget();
  log(c, PY_NAME(msgs::kEntering));
  if (f.fQuitting) {
    log(c, PY_NAME(msgs::kQuitting));
    return py::Ref::of_bool(false).release();
  }
  try {
    if (!has(f.fStatusTimeout))
      call::EnsureStatusTimeout(c);
    const double now = now_time();
    if (f._fActiveIdleStart >= 0 && f._fLastLogQueue >= 0 && now > f._fLastLogQueue + 2.0) {
      if (logging_on(c))
        sq::PrintScanQueues(queue(c), f.fLog, 10);
      f._fLastLogQueue = now;
    }
    if (f._fActiveIdleStart < 0) {
      f._fActiveIdleStart = now;
      f._fLastLogQueue = now;
    }
    call::DoScans(c, now + budget);
    if (sq::Empty(queue(c), false)) {
      f._fIdleProcId = Ref::none();
      if (call::QueuesEmpty(c, true)) {
        host::objectmodel::emit(self_of(c), PY_NAME("end"));
        f._fActiveIdleStart = -1.0;
      }
      call::ScheduleWriteToDatabaseIdle(c);
      log(c, PY_NAME(msgs::kEmpty));
      if (logging_on(c))
        sq::PrintScanQueues(queue(c), f.fLog, 10);
      return py::Ref::of_bool(false).release();
    }
    log(c, PY_NAME(msgs::kNotEmpty));
    return py::Ref::of_bool(true).release();
  } catch (...) {
    py::translate_exception();
  }
  // The exception path: nothing is rolled back.
  f._fIdleProcId = Ref::none();
  PyObject *type, *value, *tb;
  PyErr_Fetch(&type, &value, &tb);
  PyErr_NormalizeException(&type, &value, &tb);
  if (tb && value)
    PyException_SetTraceback(value, tb);
  try {
    log(c, PY_NAME(msgs::kException));
    report_current_exception(Borrowed(value));
  } catch (const py::PyError &) {
    // A failing logger or reporter must not hide the original error.
    PyErr_Clear();
  } catch (...) {
    PyErr_Clear();
  }
  if (state->debug) {
    PyErr_Restore(type, value, tb);
    return nullptr;
  }
  Py_XDECREF(type);
  Py_XDECREF(value);
  Py_XDECREF(tb);
  return py::Ref::none().release();
}

void DoScans(C *c, double end_time) {
  auto &f = c->f;
  if (f.fWaitingForRemote)
    return;
  if (!f._fAllBasicModuleQueued) {
    Ref end = py::floating(end_time);
    if (call::QueueBasicModules(c, end))
      return;
  }
  double now = now_time();
  ScanQueueObject *q = queue(c);
  while (now < end_time) {
    if (call::CheckWholeFiles(c, end_time)) {
      log(c, PY_NAME(msgs::kOutOfTime));
      return;
    }
    Ref item = sq::First(q);
    Ref fields[4];
    if (PyTuple_Check(item.get()) && PyTuple_GET_SIZE(item.get()) == 4) {
      // The queue's own CScanItem (a tuple subclass): its four fields.
      for (int i = 0; i < 4; ++i)
        fields[i] = Ref::borrow(PyTuple_GET_ITEM(item.get(), i));
    } else {
      unpack(item, 4, fields);
    }
    const Ref &loc = fields[0], &scope = fields[1], &scan_name = fields[2], &priority = fields[3];
    if (loc.is_none()) {
      log(c, PY_NAME(msgs::kLocIsNone));
      return;
    }
    Ref key = sq::make_key(q, scope, scan_name);
    Ref times = f._fLastScanCompleted;
    Ref last = py::dict_get(times, loc);
    const uint64_t times_version = py::dict_version(times);
    if (has(last)) {
      Ref t = PyDict_Check(last.get()) ? py::dict_get(last, key)
                                       : py::call_method(last, host::names().get, key);
      if (has(t)) {
        // Times recorded here are floats: compared as doubles, anything else
        // through the rich comparison.
        int recent;
        if (PyFloat_CheckExact(t.get())) {
          recent = PyFloat_AS_DOUBLE(t.get()) > now - kMinRescanInterval;
        } else {
          Ref threshold = py::floating(now - kMinRescanInterval);
          recent = PyObject_RichCompareBool(t.get(), threshold.get(), Py_GT);
          if (recent < 0)
            py::throw_error();
        }
        if (recent) {
          log(c, PY_NAME(msgs::kTooRecent), tuple_of(loc, scope, scan_name));
          sq::ScanCompleted(q, item, key);
          return;
        }
      }
    }
    if (!is_python(c, loc)) {
      log(c, PY_NAME(msgs::kNotPython), tuple_of(loc, scope, scan_name));
      sq::RemoveScanTriple(q, loc, scope, scan_name, priority, true, Borrowed());
    } else {
      f.fActiveLoc = loc;
      if (call::DoSingleScan(c, item, end_time))
        return;
      sq::ScanCompleted(q, item, key);
      py::call_method(f._fInfoCache, PY_NAME("Trim"));
      // The entry looked up before the scan is still the one stored unless
      // the table changed meanwhile.
      Ref per_loc = py::dict_version(times) == times_version ? last : py::dict_get(times, loc);
      if (!per_loc) {
        per_loc = py::new_dict();
        py::dict_set(times, loc, per_loc);
      }
      Ref when = py::floating(now);
      if (PyDict_CheckExact(per_loc.get()))
        py::dict_set(per_loc, key, when);
      else
        py::check_int(PyObject_SetItem(per_loc.get(), key.get(), when.get()));
      f.fActiveLoc = Ref::none();
      if (py::eq(scan_name, host::anamgr::DerivedScanName(f.fAnaMgr)))
        py::set_add(f.fCompletedLocs, loc);
    }
    now = now_time();
  }
}

bool CheckWholeFiles(C *c, double end_time) {
  auto &f = c->f;
  ScanQueueObject *q = queue(c);
  Ref whole = sq::PopWholeFilesToCheck(q, kMaxWholeFilesPerCheck);
  while (!whole.is_none()) {
    // check = dict(whole): the queue's (loc, priority) tuples stored directly.
    Ref check = py::new_dict();
    bool pairs = PyList_CheckExact(whole.get());
    for (Py_ssize_t i = 0; pairs && i < PyList_GET_SIZE(whole.get()); ++i) {
      PyObject *t = PyList_GET_ITEM(whole.get(), i);
      pairs = PyTuple_CheckExact(t) && PyTuple_GET_SIZE(t) == 2;
    }
    if (pairs) {
      for (Py_ssize_t i = 0; i < PyList_GET_SIZE(whole.get()); ++i) {
        Ref t = Ref::borrow(PyList_GET_ITEM(whole.get(), i));
        py::dict_set(check, Borrowed(PyTuple_GET_ITEM(t.get(), 0)),
                     Borrowed(PyTuple_GET_ITEM(t.get(), 1)));
      }
    } else {
      py::check_int(PyDict_MergeFromSeq2(check.get(), whole.get(), 1));
    }
    log(c, PY_NAME(msgs::kChecking), whole);
    Ref keys = py::check(PyDict_Keys(check.get()));
    Ref mtime_dict = call::GetModtimeDict(c, keys);
    if (!PyDict_Check(mtime_dict.get())) {
      PyErr_Format(PyExc_TypeError, msg::kExpectedType, "dict", Py_TYPE(mtime_dict.get())->tp_name);
      py::throw_error();
    }
    Ref missing = py::new_list(), existing = py::new_dict();
    {
      std::vector<std::pair<Ref, Ref>> items;
      Py_ssize_t pos = 0;
      PyObject *k, *v;
      items.reserve(static_cast<size_t>(PyDict_GET_SIZE(mtime_dict.get())));
      while (PyDict_Next(mtime_dict.get(), &pos, &k, &v))
        items.emplace_back(Ref::borrow(k), Ref::borrow(v));
      Ref zero = py::integer(0);
      for (auto &kv : items) {
        py::dict_set(f._fMTimeAtLastWholeFileCheck, kv.first, kv.second);
        // mtime == 0, for the float or int times the host gives, in C.
        PyObject *t = kv.second.get();
        const bool is_zero = PyFloat_CheckExact(t)  ? PyFloat_AS_DOUBLE(t) == 0.0
                             : PyLong_CheckExact(t) ? Py_SIZE(t) == 0
                                                    : py::eq(kv.second, zero);
        if (is_zero)
          py::list_append(missing, kv.first);
        else
          py::dict_set(existing, kv.first, kv.second);
      }
    }
    Ref scans_done =
        py::call_method(f._fInfoCache, PY_NAME("GetScansDoneForMultipleFiles"), existing);
    log(c, PY_NAME(msgs::kScansDone), scans_done);
    if (!PyDict_Check(scans_done.get())) {
      PyErr_Format(PyExc_TypeError, msg::kExpectedType, "dict", Py_TYPE(scans_done.get())->tp_name);
      py::throw_error();
    }
    Ref up_to_date = py::new_list();
    {
      std::vector<std::pair<Ref, Ref>> items;
      Py_ssize_t pos = 0;
      PyObject *k, *v;
      items.reserve(static_cast<size_t>(PyDict_GET_SIZE(scans_done.get())));
      while (PyDict_Next(scans_done.get(), &pos, &k, &v))
        items.emplace_back(Ref::borrow(k), Ref::borrow(v));
      for (auto &kv : items) {
        const Ref &loc = kv.first, &done = kv.second;
        Ref primary = host::anamgr::PrimaryScanName(f.fAnaMgr);
        int has_primary = PySequence_Contains(done.get(), primary.get());
        if (has_primary < 0)
          py::throw_error();
        if (!has_primary)
          continue;
        py::list_append(up_to_date, loc);
        sq::RemoveAllForLocation(q, loc, Borrowed(), true);
        Ref derived = host::anamgr::DerivedScanName(f.fAnaMgr);
        int has_derived = PySequence_Contains(done.get(), derived.get());
        if (has_derived < 0)
          py::throw_error();
        if (!has_derived && host::infocache::WantDerivedInfo(f._fInfoCache, loc)) {
          Ref prio = py::dict_get(check, loc);
          if (!prio)
            prio = state->priorities[kBackgroundPriority];
          Ref pair = py::check(PyTuple_Pack(2, loc.get(), state->kWildcardScope.get()));
          Ref pairs = py::check(PyList_New(1));
          PyList_SET_ITEM(pairs.get(), 0, pair.release());
          call::AddPairsToSecondaryQueue(c, pairs, Borrowed(Py_False), prio);
        }
      }
    }
    sq::RemoveAllForLocations(q, missing, Borrowed(), true);
    // Imports of the up-to-date files, grouped by (directory, priority).
    Ref groups = py::new_dict();
    Ref imports = py::call_method(f._fInfoCache, PY_NAME("GetAllImports"), up_to_date);
    py::for_each(imports, [&](Borrowed rec) {
      Ref parts[3];
      unpack(rec, 3, parts);
      Ref prio = py::dict_get(check, parts[0]);
      if (!prio)
        prio = state->priorities[kBackgroundPriority];
      Ref dirloc = py::call_method(parts[0], PY_NAME("GetParentDir"));
      Ref key = py::check(PyTuple_Pack(2, dirloc.get(), prio.get()));
      Ref equivs = py::dict_get(groups, key);
      if (!equivs) {
        equivs = py::new_set();
        py::dict_set(groups, key, equivs);
      }
      py::set_add(equivs, parts[2]);
    });
    {
      std::vector<std::pair<Ref, Ref>> items;
      Py_ssize_t pos = 0;
      PyObject *k, *v;
      items.reserve(static_cast<size_t>(PyDict_GET_SIZE(groups.get())));
      while (PyDict_Next(groups.get(), &pos, &k, &v))
        items.emplace_back(Ref::borrow(k), Ref::borrow(v));
      for (auto &kv : items) {
        Borrowed dirloc(PyTuple_GET_ITEM(kv.first.get(), 0));
        Borrowed prio(PyTuple_GET_ITEM(kv.first.get(), 1));
        call::AddImportEquivsToQueue(c, kv.second, dirloc, prio);
      }
    }
    if (now_time() >= end_time)
      return true;
    whole = sq::PopWholeFilesToCheck(q, kMaxWholeFilesPerCheck);
  }
  return false;
}

bool DoSingleScan(C *c, Borrowed scan_item, double end_time) {
  auto &f = c->f;
  f.fActiveScanItem = scan_item.ref();
  struct Reset {
    C *c;
    ~Reset() { c->f.fActiveScanItem = Ref::none(); }
  } reset{c};
  const ItemFields fields(scan_item, 0b0111);
  const Borrowed loc = fields[0], scope = fields[1], scan_name = fields[2];
  const bool whole_file = py::eq(scope, state->kWildcardScope);
  bool result;
  if (py::eq(scan_name, host::anamgr::PrimaryScanName(f.fAnaMgr))) {
    result = whole_file ? call::DoPrimaryWholeFileScan(c, scan_item, end_time)
                        : call::DoPrimarySingleScopeScan(c, scan_item, end_time);
  } else {
    Ref loc_cache = py::getattr(f._fInfoCache, PY_NAME("fLocCache"));
    if (py::call_method(loc_cache, PY_NAME("GetBuiltinLoc")).is_none())
      return false;
    result = whole_file ? call::DoSecondaryWholeFileScan(c, scan_item, end_time)
                        : call::DoSecondarySingleScopeScan(c, loc, scope, end_time);
  }
  if (result)
    return true;
  py::call_method(f._fInfoCache, PY_NAME("FinishedWithScans"), loc, scope, scan_name);
  // _fScanTripleCompletedCount[(loc, scope, scan name)] += 1, the triple
  // hashed once for the lookup and the store.
  Ref key = tuple_of(loc, scope, scan_name);
  Ref counts = f._fScanTripleCompletedCount;
  const Py_hash_t h = py::hash(key);
  Ref old = Ref::borrow(_PyDict_GetItem_KnownHash(counts.get(), key.get(), h));
  if (!old && PyErr_Occurred())
    py::throw_error();
  Ref now = old ? py::check(PyNumber_Add(old.get(), state->one.get())) : state->one;
  py::check_int(_PyDict_SetItem_KnownHash(counts.get(), key.get(), now.get(), h));
  return false;
}

Ref GetAnalysis(C *c, Borrowed loc, bool create) {
  Ref ana = py::call_method(c->f.fCacheMgr, PY_NAME("GetAnalysis"), loc,
                            Borrowed(create ? Py_True : Py_False));
  Ref cls = host::attr(host::Attr::CPySourceAnalysis);
  int is = PyObject_IsInstance(ana.get(), cls.get());
  if (is < 0)
    py::throw_error();
  return is ? ana : Ref::none();
}

} // namespace scancoord::co
