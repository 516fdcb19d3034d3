// CScanCoordinator: synchronous scanning for the editor.
//
// TryToScanDictNow scans the primary triples of a needs-scan set on the
// caller's stack within a deadline and queues the rest.  Two sets guard
// re-entry (a scan may ask for information that triggers another
// TryToScanDictNow on the same thread): _fActiveScanNowTriples holds the
// triples being scanned further up the stack, _fPendingScanNowTriples those
// an outer call has promised to scan.  Every way out, exceptions included,
// restores both sets to what they held before the call and queues what was
// not scanned, so nothing is scanned twice and nothing is lost.
//
// A synchronous primary scan that ends unfinished (neither waiting for data,
// finished nor abandoned) is re-queued and stays queued: its partial results
// are saved, and the idle loop completes it later.
#include "pysource/scancoordinator/coordinator.hpp"
#include "pysource/scancoordinator/scanqueue.hpp"
#include "host/anamgr.hpp"
#include "host/gui.hpp"
#include "host/hostmodules.hpp"
#include "host/objectmodel.hpp"
#include "host/scanners.hpp"

namespace scancoord::co {

namespace {

// Run `cleanup` while an exception is pending, then re-raise: the original
// exception, or the clean-up's own (with the original as its context), as a
// `finally` block would.
template <typename F> [[noreturn]] void rethrow_after(F &&cleanup) {
  PyObject *type, *value, *tb;
  PyErr_Fetch(&type, &value, &tb);
  PyErr_NormalizeException(&type, &value, &tb);
  if (tb && value)
    PyException_SetTraceback(value, tb);
  try {
    cleanup();
  } catch (...) {
    py::translate_exception();
    PyObject *type2, *value2, *tb2;
    PyErr_Fetch(&type2, &value2, &tb2);
    PyErr_NormalizeException(&type2, &value2, &tb2);
    if (value2 && value)
      PyException_SetContext(value2, value); // steals value
    else
      Py_XDECREF(value);
    Py_XDECREF(type);
    Py_XDECREF(tb);
    PyErr_Restore(type2, value2, tb2);
    throw py::PyError();
  }
  PyErr_Restore(type, value, tb);
  throw py::PyError();
}

double time_time() {
  Ref t = py::call(py::getattr(host::modules->time, PY_NAME("time")));
  double v = PyFloat_AsDouble(t.get());
  if (v == -1.0 && PyErr_Occurred())
    py::throw_error();
  return v;
}

// The first definition in `infos` of a method (bound or unbound), unpacked,
// or an empty Ref.
Ref find_method_def(Borrowed infos) {
  Borrowed si = host::modules->symbolinfo;
  Ref method = py::getattr(si, PY_NAME("kMethodPrefix")),
      unbound = py::getattr(si, PY_NAME("kUnboundMethodPrefix"));
  Ref prefixes = py::check(PyTuple_Pack(2, method.get(), unbound.get()));
  if (!py::truth(py::call(py::getattr(si, PY_NAME("InfoContains")), infos, prefixes)))
    return Ref();
  Ref parts = py::call(py::getattr(si, PY_NAME("NonNestedSplit")), infos, like(infos, ";"));
  Ref found;
  py::for_each(parts, [&](Borrowed part) {
    if (found || !(starts_with(part, method) || starts_with(part, unbound)))
      return;
    if (!PyBytes_Check(part.get())) {
      PyErr_Format(PyExc_TypeError, msg::kExpectedType, "bytes", Py_TYPE(part.get())->tp_name);
      py::throw_error();
    }
    found = py::call(py::getattr(si, PY_NAME("UnpackDefInfoStr")), part);
  });
  return found;
}

std::vector<std::pair<Ref, Ref>> items_of(Borrowed mapping) {
  std::vector<std::pair<Ref, Ref>> out;
  Ref items = py::call_method(mapping, host::names().items);
  py::for_each(items, [&](Borrowed kv) {
    Ref parts[2];
    unpack(kv, 2, parts);
    out.emplace_back(std::move(parts[0]), std::move(parts[1]));
  });
  return out;
}

Ref primary_name_from_singletons() {
  Ref mgr = py::getattr(host::gui::GetSingletons(), PY_NAME("fAnalysisMgr"));
  return host::anamgr::PrimaryScanName(mgr);
}

} // namespace

bool TryToScanDictNow(C *c, Borrowed, Borrowed, Borrowed needs_scan_set, double end_time) {
  auto &f = c->f;
  Ref needs = needs_scan_set.ref();
  if (!py::truth(needs))
    return false;
  Ref primary = host::anamgr::PrimaryScanName(f.fAnaMgr);
  Ref active = f._fActiveScanNowTriples, pending = f._fPendingScanNowTriples;
  std::vector<Ref> primary_list;
  py::for_each(needs, [&](Borrowed t) {
    Ref parts[3];
    unpack(t, 3, parts);
    Ref triple = tuple_of(parts[0], parts[1], parts[2]);
    if (py::set_contains(active, triple))
      return;
    if (py::eq(parts[2], primary))
      primary_list.push_back(triple);
    else if (!py::set_contains(pending, triple))
      call::AddPairToSecondaryQueue(c, parts[0], parts[1], Borrowed(Py_True), Borrowed(Py_None));
  });
  if (primary_list.empty())
    return false;
  Ref primary_set = py::new_set(), added = py::new_set();
  for (auto &t : primary_list)
    py::set_add(primary_set, t);
  py::for_each(primary_set, [&](Borrowed t) {
    if (!py::set_contains(pending, t))
      py::set_add(added, t);
  });
  py::for_each(added, [&](Borrowed t) { py::set_add(pending, t); });

  auto outer_cleanup = [&] {
    py::for_each(added, [&](Borrowed t) { py::set_discard(pending, t); });
    if (PySet_GET_SIZE(primary_set.get()) != 0)
      call::AddNeedsScanSetToQueues(c, primary_set);
  };
  bool finished = true;
  try {
    for (auto &t : primary_list) {
      if (!py::set_contains(pending, t))
        continue; // a nested call has served it
      py::set_add(active, t);
      bool out_of_time = false;
      try {
        Borrowed loc(PyTuple_GET_ITEM(t.get(), 0)), scope(PyTuple_GET_ITEM(t.get(), 1)),
            scan_name(PyTuple_GET_ITEM(t.get(), 2));
        Ref names = py::check(PyList_New(1));
        PyList_SET_ITEM(names.get(), 0, scan_name.ref().release());
        call::TryToScanNow(c, loc, scope, names, end_time, Borrowed(Py_True));
        out_of_time = time_time() > end_time;
        if (!out_of_time) {
          py::set_discard(pending, t);
          py::set_discard(primary_set, t);
        }
      } catch (...) {
        py::translate_exception();
        rethrow_after([&] { py::set_discard(active, t); });
      }
      py::set_discard(active, t);
      if (out_of_time) {
        finished = false;
        break;
      }
    }
  } catch (...) {
    py::translate_exception();
    rethrow_after(outer_cleanup);
  }
  outer_cleanup();
  return finished;
}

Ref TryToScanNow(C *c, Borrowed loc, Borrowed scope_name, Borrowed scan_name_list, double end_time,
                 Borrowed) {
  auto &f = c->f;
  Borrowed si = host::modules->symbolinfo;
  if (py::truth(py::call(py::getattr(si, PY_NAME("IsInstanceScope")), scope_name)))
    return call::TryToScanInstanceScopeNow(c, loc, scope_name, end_time);
  Ref primary = host::anamgr::PrimaryScanName(f.fAnaMgr);
  Ref derived = host::anamgr::DerivedScanName(f.fAnaMgr);
  Ref names = scan_name_list.ref();
  if (!names || names.is_none()) {
    names = py::new_list();
    py::list_append(names, primary);
    py::list_append(names, derived);
  }
  int do_primary = PySequence_Contains(names.get(), primary.get());
  if (do_primary < 0)
    py::throw_error();
  int do_secondary = PySequence_Contains(names.get(), derived.get());
  if (do_secondary < 0)
    py::throw_error();

  if (do_primary) {
    Ref incomplete = py::check(PyObject_GetItem(f._fIncompleteScansByLoc.get(), loc.get()));
    static Ref *kw = new Ref(
        py::check(PyTuple_Pack(2, PY_NAME("incomplete_scope_set").get(), PY_NAME("log").get())));
    PyObject *argv[] = {loc.get(), scope_name.get(), incomplete.get(), f.fLog.get()};
    Ref scanner = py::call_kw(host::attr(host::Attr::CSingleScopePrimaryScanner), argv, 2, *kw);
    Ref result;
    try {
      Ref st = py::call_method(scanner, PY_NAME("Scan"), py::floating(end_time));
      if (py::truth(py::getattr(scanner, PY_NAME("fFileDoesntExist")))) {
        sq::RemoveScanTriple(queue(c), loc, scope_name, primary, Borrowed(), true, Borrowed());
        result = state->not_found_result;
      } else {
        const bool finished = st.get() == host::attr(host::Attr::kFinishedScanning).get() ||
                              st.get() == host::attr(host::Attr::kScanAbandoned).get();
        if (!finished)
          call::AddPairsToPrimaryQueue(c, one_pair_list(loc, scope_name), Borrowed(Py_True),
                                       Borrowed(Py_None));
        if (st.get() == host::attr(host::Attr::kWaitingForData).get()) {
          result = state->waiting_result;
        } else {
          py::call_method(scanner, PY_NAME("SaveToInfoCache"));
          // An unfinished scan stays queued so the idle loop completes it.
          if (finished)
            sq::RemoveScanTriple(queue(c), loc, scope_name, primary, Borrowed(), true, Borrowed());
        }
      }
    } catch (...) {
      py::translate_exception();
      rethrow_after([&] { host::objectmodel::destroy(scanner); });
    }
    host::objectmodel::destroy(scanner);
    if (result)
      return result;
  }
  if (do_secondary) {
    if (!call::DoSecondarySingleScopeScan(c, loc, scope_name, end_time))
      sq::RemoveScanTriple(queue(c), loc, scope_name, derived, Borrowed(), true, Borrowed());
  }
  return Ref::none();
}

Ref TryToScanInstanceScopeNow(C *c, Borrowed loc, Borrowed scope_name, double end_time) {
  auto &f = c->f;
  Borrowed si = host::modules->symbolinfo;
  if (state->debug && !py::truth(py::call(py::getattr(si, PY_NAME("IsInstanceScope")), scope_name)))
    assertion_failed();
  Ref class_name = py::call(py::getattr(si, PY_NAME("GetClassForInstanceName")), scope_name);
  Ref ctx = py::call_method(f._fInferenceEngine, PY_NAME("NewContext"), py::floating(end_time));
  static Ref *s_get = new Ref(PY_NAME("GetScopeInfo"));
  static Ref *s_out = new Ref(PY_NAME("OutOfTime"));
  Ref class_info = py::call_method(f._fInferenceEngine, *s_get, loc, class_name, ctx);
  if (class_info.is_none() || py::truth(py::call_method(ctx, *s_out)))
    return Ref::none();
  bool complete = true;
  Ref methods = py::new_list();
  for (auto &kv : items_of(py::getattr(class_info, PY_NAME("type_equivs")))) {
    Ref def = find_method_def(kv.second);
    if (!def)
      continue;
    Ref info = py::call_method(f._fInferenceEngine, *s_get, loc,
                               py::getattr(def, PY_NAME("scope_name")), ctx);
    if (!info.is_none())
      py::list_append(methods, info);
    if (py::truth(py::call_method(ctx, *s_out))) {
      complete = false;
      break;
    }
  }
  Ref primary = primary_name_from_singletons();
  Ref inst =
      py::call(host::scanners::Class(PY_NAME("CreateClassInstInfo")), class_info, methods, primary);
  if (complete) {
    py::call_method(f._fInfoCache, PY_NAME("AddScopeInfo"), inst);
    Ref stored = py::call_method(f._fInfoCache, *s_get, loc, scope_name);
    if (!stored.is_none())
      return stored;
  }
  return inst;
}

Ref BuildInstanceScopeNoScanning(C *c, Borrowed loc, Borrowed scope_name, double) {
  auto &f = c->f;
  Borrowed si = host::modules->symbolinfo;
  if (state->debug && !py::truth(py::call(py::getattr(si, PY_NAME("IsInstanceScope")), scope_name)))
    assertion_failed();
  Ref info_cache = f._fInfoCache;
  static Ref *s_get = new Ref(PY_NAME("GetScopeInfo"));
  static Ref *s_add = new Ref(PY_NAME("AddScopeInfo"));
  Ref class_name = py::call(py::getattr(si, PY_NAME("GetClassForInstanceName")), scope_name);
  Ref class_info = py::call_method(info_cache, *s_get, loc, class_name);
  if (class_info.is_none()) {
    Ref pl = py::call(py::getattr(si, PY_NAME("ParentAndLeafScopeNames")), class_name);
    Ref parts[2];
    unpack(pl, 2, parts);
    Ref parent_info = py::call_method(info_cache, *s_get, loc, parts[0]);
    if (parent_info.is_none()) {
      call::AddPairsToPrimaryQueue(c, one_pair_list(loc, parts[0]), Borrowed(Py_True),
                                   Borrowed(Py_None));
      return Ref::none();
    }
    Ref split = py::call(py::getattr(si, PY_NAME("SplitScopeNameFromSuffixes")), parts[1]);
    Ref leaf = py::check(PySequence_GetItem(split.get(), 0));
    Ref entry =
        py::call_method(py::getattr(parent_info, PY_NAME("type_equivs")), host::names().get, leaf);
    const bool exists =
        !entry.is_none() && py::truth(py::call(py::getattr(si, PY_NAME("InfoContains")), entry,
                                               py::getattr(si, PY_NAME("kClassPrefix"))));
    if (!exists) {
      Ref primary = host::anamgr::PrimaryScanName(f.fAnaMgr);
      Ref mtime = py::getattr(parent_info, PY_NAME("disk_mtime"));
      Borrowed scopeinfo = host::modules->scopeinfo;
      static Ref *kw = new Ref(py::check(PyTuple_Pack(1, PY_NAME("does_not_exist").get())));
      auto make = [&](Borrowed name) {
        Ref key = py::call(py::getattr(scopeinfo, PY_NAME("CScopeInfoKey")), loc, name, primary,
                           loc, name);
        Ref empty = PY_NAME("");
        PyObject *argv[] = {key.get(), empty.get(), mtime.get(), Py_False, Py_True};
        Ref info = py::call_kw(py::getattr(scopeinfo, PY_NAME("CScopeInfo")), argv, 4, *kw);
        py::call_method(info_cache, *s_add, info);
        return info;
      };
      make(class_name);
      Ref inst_name = py::call(py::getattr(si, PY_NAME("GetInstanceNameForClass")), class_name);
      return make(inst_name);
    }
    call::AddPairsToPrimaryQueue(c, one_pair_list(loc, class_name), Borrowed(Py_True),
                                 Borrowed(Py_None));
    return Ref::none();
  }
  Ref missing = py::new_list(), methods = py::new_list();
  for (auto &kv : items_of(py::getattr(class_info, PY_NAME("type_equivs")))) {
    Ref def = find_method_def(kv.second);
    if (!def)
      continue;
    Ref name = py::getattr(def, PY_NAME("scope_name"));
    Ref info = py::call_method(info_cache, *s_get, loc, name);
    if (info.is_none())
      py::list_append(missing, py::check(PyTuple_Pack(2, loc.get(), name.get())));
    else
      py::list_append(methods, info);
  }
  if (PyList_GET_SIZE(missing.get()) != 0) {
    call::AddPairsToPrimaryQueue(c, missing, Borrowed(Py_True), Borrowed(Py_None));
    return Ref::none();
  }
  Ref primary = primary_name_from_singletons();
  Ref inst =
      py::call(host::scanners::Class(PY_NAME("CreateClassInstInfo")), class_info, methods, primary);
  py::call_method(info_cache, *s_add, inst);
  return inst;
}

} // namespace scancoord::co
