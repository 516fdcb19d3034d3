// CScanCoordinator: scan execution.
//
// Each of the four scan methods runs at most one slice of one scan: exactly
// one Scan(end_time) call on the scanner kept in its active dictionary
// (created on first use, so a scan that needs several slices is resumed by
// the same scanner), then, when the scanner reports it finished or gave up,
// the entry is removed, the scanner destroyed and the follow-up work queued
// in the same call.  True means "not finished": the item stays queued (or
// parked while a primary scanner waits for data); False means done.
#include "pysource/scancoordinator/coordinator.hpp"
#include "pysource/scancoordinator/scanqueue.hpp"
#include "host/anamgr.hpp"
#include "host/hostmodules.hpp"
#include "host/infocache.hpp"
#include "host/objectmodel.hpp"
#include "host/scanners.hpp"

namespace scancoord::co {

namespace {

namespace msgs {
constexpr const char *kStartScope = "starting primary scope scan: scope=%r, file=%r";
constexpr const char *kFinishScope = "finished primary scope scan: scope=%r, file=%r, changed=%s";
constexpr const char *kStartWhole = "Starting primary whole file scan: %r";
constexpr const char *kFinishWhole = "Finished primary whole file scan: %r";
constexpr const char *kStartSecondary = "Starting secondary whole file scan: %r";
constexpr const char *kFinishSecondary = "Finished secondary whole file scan: %r";
} // namespace msgs

enum class Outcome { Waiting, Unfinished, Finished, Abandoned };

Outcome run_slice(Borrowed scanner, double end_time) {
  Ref end = host::Snapshot::floating(end_time);
  Ref st = py::call_method(scanner, PY_NAME("Scan"), end);
  if (py::eq(st, host::attr(host::Attr::kWaitingForData)))
    return Outcome::Waiting;
  if (py::eq(st, host::attr(host::Attr::kFinishedScanning)))
    return Outcome::Finished;
  if (py::eq(st, host::attr(host::Attr::kScanAbandoned)))
    return Outcome::Abandoned;
  return Outcome::Unfinished;
}

// d.pop(key, None): one lookup.
void dict_discard(Borrowed d, Borrowed key) {
  Ref dropped = py::check(_PyDict_Pop(d.get(), key.get(), Py_None));
}

// self._fIncompleteScansByLoc[loc]: the location's set, created when missing.
// The field is a defaultdict(set); while it still is exactly that, a missing
// set is made and stored here, as its __missing__ would.
Ref incomplete_set(C *c, Borrowed loc) {
  Borrowed d = c->f._fIncompleteScansByLoc;
  if (Py_TYPE(d.get()) == reinterpret_cast<PyTypeObject *>(state->defaultdict.get())) {
    const Py_hash_t h = py::hash(loc);
    PyObject *v = _PyDict_GetItem_KnownHash(d.get(), loc.get(), h);
    if (v)
      return Ref::borrow(v);
    if (PyErr_Occurred())
      py::throw_error();
    Ref factory = py::getattr(d, PY_NAME("default_factory"));
    if (factory.get() == reinterpret_cast<PyObject *>(&PySet_Type)) {
      Ref s = py::new_set();
      py::check_int(_PyDict_SetItem_KnownHash(d.get(), loc.get(), s.get(), h));
      return s;
    }
  }
  return py::check(PyObject_GetItem(d.get(), loc.get()));
}

// cls(a, b, incomplete_scope_set=incomplete, log=log)
Ref new_scanner(host::Attr cls, Borrowed a, Borrowed b, Borrowed incomplete, Borrowed log) {
  Ref type = host::attr(cls);
  static Ref *kw = new Ref(
      py::check(PyTuple_Pack(2, PY_NAME("incomplete_scope_set").get(), PY_NAME("log").get())));
  PyObject *argv[] = {a.get(), b.get(), incomplete.get(), log.get()};
  return py::call_kw(type, argv, 2, *kw);
}

} // namespace

bool DoPrimaryWholeFileScan(C *c, Borrowed scan_item, double end_time) {
  auto &f = c->f;
  Ref ana_mgr = py::getattr(f.fSingletons, PY_NAME("fAnalysisMgr"));
  const ItemFields fields(scan_item, 0b1101);
  const Borrowed loc = fields[0], scan_name = fields[2], priority = fields[3];
  Ref active = f.fActivePrimaryWholeFileScanners;
  Ref scanner = py::dict_get(active, loc);
  if (!scanner) {
    Ref incomplete = incomplete_set(c, loc);
    scanner = new_scanner(host::Attr::CWholeFilePrimaryScanner, loc, scan_name, incomplete, f.fLog);
    py::dict_set(active, loc, scanner);
    log(c, PY_NAME(msgs::kStartWhole), loc);
  }
  const Outcome out = run_slice(scanner, end_time);
  if (out == Outcome::Waiting) {
    call::WaitForScannerToBeReady(c, scanner, scan_item);
    return true;
  }
  if (out == Outcome::Unfinished)
    return true;
  log(c, PY_NAME(msgs::kFinishWhole), loc);
  dict_discard(active, loc);
  host::objectmodel::destroy(scanner);
  if (out == Outcome::Abandoned)
    return false;

  Ref incomplete = py::dict_get(f._fIncompleteScansByLoc, loc);
  if (incomplete) {
    const Py_ssize_t n = PyObject_Size(incomplete.get());
    if (n < 0)
      py::throw_error();
    if (n == 0)
      dict_discard(f._fIncompleteScansByLoc, loc);
  }

  Ref locs = py::check(PyList_New(1));
  PyList_SET_ITEM(locs.get(), 0, Ref(loc).release());
  Ref imported = py::new_list();
  py::for_each(py::call_method(f._fInfoCache, PY_NAME("GetAllImports"), locs), [&](Borrowed rec) {
    Ref last = py::check(PySequence_GetItem(rec.get(), -1));
    py::list_append(imported, last);
  });
  Ref dirloc = py::call_method(loc, PY_NAME("GetParentDir"));
  call::AddImportEquivsToQueue(c, imported, dirloc, priority);

  Ref factory = host::anamgr::AnalysisFactory(ana_mgr);
  Ref sec = py::call_method(factory, PY_NAME("GetSecondaryLocations"), loc);
  if (py::truth(sec)) {
    Ref pairs = py::new_list();
    py::for_each(sec, [&](Borrowed l) {
      py::list_append(pairs, py::check(PyTuple_Pack(2, l.get(), state->kWildcardScope.get())));
    });
    call::AddPairsToPrimaryQueue(c, pairs, Borrowed(Py_True), priority);
  }
  call::AddPairToSecondaryQueue(c, loc, state->kWildcardScope, Borrowed(Py_True), priority);
  return false;
}

bool DoPrimarySingleScopeScan(C *c, Borrowed scan_item, double end_time) {
  auto &f = c->f;
  const ItemFields fields(scan_item, 0b1011);
  const Borrowed loc = fields[0], scope = fields[1], priority = fields[3];
  Ref symbolinfo = host::modules->symbolinfo;
  if (py::truth(py::call(py::getattr(symbolinfo, PY_NAME("IsInstanceScope")), scope))) {
    call::BuildInstanceScopeNoScanning(c, loc, scope, end_time);
    return false;
  }
  Ref key = py::check(PyTuple_Pack(2, loc.get(), scope.get()));
  Ref active = f.fActivePrimarySingleScopeScanners;
  Ref scanner = py::dict_get(active, key);
  if (!scanner) {
    Ref ana = call::GetAnalysis(c, loc, false);
    if (has(ana))
      py::call_method(ana, PY_NAME("UpdateFromCache"));
    Ref incomplete = incomplete_set(c, loc);
    scanner = new_scanner(host::Attr::CSingleScopePrimaryScanner, loc, scope, incomplete, f.fLog);
    py::dict_set(active, key, scanner);
    py::call(f.fLog, PY_NAME(msgs::kStartScope), scope, loc);
  }
  const Outcome out = run_slice(scanner, end_time);
  if (out == Outcome::Waiting) {
    call::WaitForScannerToBeReady(c, scanner, scan_item);
    return true;
  }
  if (out == Outcome::Unfinished)
    return true;
  dict_discard(active, key);
  Ref changed = py::call_method(scanner, PY_NAME("SaveToInfoCache"), py::Borrowed(Py_False));
  py::call(f.fLog, PY_NAME(msgs::kFinishScope), scope, loc, changed);
  if (!py::truth(changed)) {
    host::objectmodel::destroy(scanner);
    return false;
  }
  // Import equivalents of the new information.
  Ref imported = py::new_list();
  Ref info = py::getattr(scanner, PY_NAME("fInfo"));
  if (!info.is_none()) {
    Ref import_prefix = py::getattr(symbolinfo, PY_NAME("kImportPrefix"));
    Ref from_prefix = py::getattr(symbolinfo, PY_NAME("kFromImportPrefix"));
    Ref split = py::getattr(symbolinfo, PY_NAME("NonNestedSplit"));
    Ref values = py::call_method(py::getattr(info, PY_NAME("type_equivs")), PY_NAME("values"));
    py::for_each(values, [&](Borrowed value) {
      py::for_each(py::call(split, value, like(value, ";")), [&](Borrowed part) {
        if (starts_with(part, import_prefix) || starts_with(part, from_prefix))
          py::list_append(imported, part);
      });
    });
  }
  if (PyList_GET_SIZE(imported.get()) != 0) {
    Ref dirloc = py::call_method(loc, PY_NAME("GetParentDir"));
    call::AddImportEquivsToQueue(c, imported, dirloc, priority);
  }
  call::AddPairToSecondaryQueue(c, loc, scope, Borrowed(Py_False), Borrowed(Py_None));
  Ref scope_def = py::getattr(scanner, PY_NAME("fScopeDef"));
  if (!scope_def.is_none()) {
    Ref inst = Ref::none();
    Ref get_inst = py::getattr(symbolinfo, PY_NAME("GetInstanceNameForClass"));
    Ref class_def = py::getattr(host::modules->logicalline, PY_NAME("kClassDef"));
    if (py::eq(py::getattr(scope_def, PY_NAME("fType")), class_def)) {
      inst = py::call(get_inst, scope);
    } else if (!py::getattr(scanner, PY_NAME("fContainingClassDef")).is_none()) {
      Ref parent = py::call(py::getattr(symbolinfo, PY_NAME("ParentScopeName")), scope);
      inst = py::call(get_inst, parent);
    }
    if (!inst.is_none())
      call::AddPairsToPrimaryQueue(c, one_pair_list(loc, inst), Borrowed(Py_True),
                                   Borrowed(Py_None));
  }
  host::objectmodel::destroy(scanner);
  return false;
}

bool DoSecondaryWholeFileScan(C *c, Borrowed scan_item, double end_time) {
  auto &f = c->f;
  const ItemFields fields(scan_item, 0b0101);
  const Borrowed loc = fields[0], scan_name = fields[2];
  if (!host::infocache::WantDerivedInfo(f._fInfoCache, loc))
    return false;
  Ref base = host::attr(host::Attr::CScanner);
  auto require_scanner = [&](const Ref &s) {
    int ok = PyObject_IsInstance(s.get(), base.get());
    if (ok < 0)
      py::throw_error();
    if (!ok) {
      PyErr_Format(PyExc_TypeError, msg::kExpectedType, "CScanner", Py_TYPE(s.get())->tp_name);
      py::throw_error();
    }
  };
  Ref active = f.fActiveSecondaryWholeFileScanners;
  Ref scanner = py::dict_get(active, loc);
  if (scanner && !scanner.is_none()) {
    require_scanner(scanner);
  } else {
    scanner = py::call(host::attr(host::Attr::CWholeFileSecondaryScanner), loc, scan_name, f.fLog);
    require_scanner(scanner);
    py::dict_set(active, loc, scanner);
    log(c, PY_NAME(msgs::kStartSecondary), loc);
  }
  const Outcome out = run_slice(scanner, end_time);
  if (out != Outcome::Finished && out != Outcome::Abandoned)
    return true;
  log(c, PY_NAME(msgs::kFinishSecondary), loc);
  dict_discard(active, loc);
  host::objectmodel::destroy(scanner);
  return false;
}

bool DoSecondarySingleScopeScan(C *c, Borrowed loc, Borrowed scope_name, double end_time) {
  auto &f = c->f;
  if (!host::infocache::WantDerivedInfo(f._fInfoCache, loc))
    return false;
  Ref info = py::call_method(f._fInfoCache, PY_NAME("GetScopeInfo"), loc, scope_name);
  if (info.is_none())
    return false;
  Ref key = py::check(PyTuple_Pack(2, loc.get(), scope_name.get()));
  Ref active = f.fActiveSecondarySingleScopeScanners;
  Ref scanner = py::dict_get(active, key);
  if (!scanner) {
    scanner = py::call(host::attr(host::Attr::CSingleScopeSecondaryScanner), info, f.fLog,
                       Borrowed(Py_None), f.fAnaMgr);
    py::dict_set(active, key, scanner);
  }
  const Outcome out = run_slice(scanner, end_time);
  if (out != Outcome::Finished && out != Outcome::Abandoned)
    return true;
  host::objectmodel::destroy(scanner);
  dict_discard(active, key);
  return false;
}

namespace {

// cb_state_change(scanner): bound to the cell (coordinator, scan item, [id]).
PyObject *cb_state_change(PyObject *cell, PyObject *scanner){
    PY_GUARD(nullptr,
             {
               C *c = reinterpret_cast<C *>(PyTuple_GET_ITEM(cell, 0));
               Borrowed item(PyTuple_GET_ITEM(cell, 1));
               Borrowed holder(PyTuple_GET_ITEM(cell, 2));
               sq::FinishedWaitingForData(queue(c), item);
               call::ScheduleIdle(c);
               Ref id = Ref::borrow(PyList_GET_ITEM(holder.get(), 0));
               if (!id.is_none())
                 py::call_method(Borrowed(scanner), host::names().disconnect, id);
               Py_RETURN_NONE;
             })}

PyMethodDef def_cb_state_change = {
  "cb_state_change",
  cb_state_change,
  METH_O,
  nullptr
};

} // namespace

void WaitForScannerToBeReady(C *c, Borrowed scanner, Borrowed scan_item) {
  sq::StartWaitingForData(queue(c), scan_item);
  Ref holder = py::check(PyList_New(1));
  PyList_SET_ITEM(holder.get(), 0, Ref::none().release());
  Ref cell = py::check(PyTuple_Pack(3, self_of(c).get(), scan_item.get(), holder.get()));
  Ref cb = py::check(PyCFunction_NewEx(&def_cb_state_change, cell.get(), nullptr));
  Ref id = host::objectmodel::connect_while_alive(scanner, PY_NAME("scan-state-changed"), cb,
                                                  self_of(c));
  py::check_int(PyList_SetItem(holder.get(), 0, id.release()));
}

} // namespace scancoord::co
