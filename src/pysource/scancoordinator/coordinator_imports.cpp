// CScanCoordinator: modification times and import equivalents.
//
// When a primary scan ends, the modules the scanned code imports are queued
// for their own whole-file scans, unless their modification time equals the
// one seen at their last whole-file check or their scan is already queued at
// the same or a more urgent priority.  Import equivalents may arrive as text
// or as UTF-8 bytes; module names handed to the analysis factory are always
// text.  A from-import equivalent whose body has no space is outside the
// equivalence format and is ignored like an equivalent of another kind.
#include "pysource/scancoordinator/coordinator.hpp"
#include "pysource/scancoordinator/scanqueue.hpp"
#include "host/anamgr.hpp"
#include "host/cachemgr.hpp"
#include "host/hostmodules.hpp"
#include "host/objectmodel.hpp"

namespace scancoord::co {

namespace {

constexpr const char *kAbortMessage = "Skipping modtime processing due to remote agent abort:";

Ref as_text(Borrowed v) {
  if (PyBytes_Check(v.get()))
    return py::check(PyUnicode_FromEncodedObject(v.get(), "utf-8", "strict"));
  if (!PyUnicode_Check(v.get())) {
    PyErr_Format(PyExc_TypeError, msg::kExpectedType, "str", Py_TYPE(v.get())->tp_name);
    py::throw_error();
  }
  return v.ref();
}

Ref first_char(Borrowed module, Borrowed name) {
  Ref s = as_text(py::getattr(module, name));
  return py::check(PyUnicode_Substring(s.get(), 0, 1));
}

Ref slice(Borrowed s, Py_ssize_t start, Py_ssize_t end) {
  Py_ssize_t n = PyUnicode_GET_LENGTH(s.get());
  if (start > n)
    start = n;
  if (end < 0)
    end = n + end < 0 ? 0 : n + end;
  if (end > n)
    end = n;
  if (end < start)
    end = start;
  return py::check(PyUnicode_Substring(s.get(), start, end));
}

// Steps 1 to 3 of building a modification-time dictionary.
Ref modtimes_for(C *c, Borrowed loc_seq) {
  Ref times = py::new_dict();
  std::vector<Ref> check_disk;
  static Ref *s_is_modified = new Ref(PY_NAME("IsModified"));
  static Ref *s_last_known = new Ref(PY_NAME("_GetLastKnownModTime"));
  static Ref *s_disk = new Ref(PY_NAME("GetDiskMTime"));
  py::for_each(loc_seq, [&](Borrowed loc) {
    Ref buf = host::cachemgr::DoesCacheBufferExist(c->f.fCacheMgr, loc);
    if (buf.is_none())
      check_disk.push_back(loc.ref());
    else if (py::truth(py::call_method(buf, *s_is_modified)))
      py::dict_set(times, loc, py::integer(-2));
    else
      py::dict_set(times, loc, py::call_method(buf, *s_last_known));
  });
  // Every disk time is fetched before the first one is stored.
  std::vector<Ref> disk_times;
  disk_times.reserve(check_disk.size());
  for (auto &loc : check_disk)
    disk_times.push_back(py::call_method(c->f._fInfoCache, *s_disk, loc));
  for (size_t i = 0; i < check_disk.size(); ++i)
    py::dict_set(times, check_disk[i], disk_times[i]);
  return times;
}

} // namespace

void AddImportEquivsToQueue(C *c, Borrowed imported_equivs, Borrowed dirloc, Borrowed priority) {
  auto &f = c->f;
  ScanQueueObject *q = queue(c);
  if (state->debug && !sq::IsTreeBranchReady(q, dirloc))
    assertion_failed();
  if (!f._fAnalyzeFoundImports)
    return;
  Ref factory = host::anamgr::AnalysisFactory(f.fAnaMgr);
  // An empty list or tuple (a scanned file that imports nothing) yields no
  // names: nothing of the symbol-information module is needed.
  if ((PyList_CheckExact(imported_equivs.get()) || PyTuple_CheckExact(imported_equivs.get())) &&
      PySequence_Fast_GET_SIZE(imported_equivs.get()) == 0)
    return;
  Ref names = py::new_set();
  Borrowed si = host::modules->symbolinfo;
  const Py_ssize_t prefix_len = py::as_ll(py::getattr(si, PY_NAME("kPrefixLen")));
  Ref import_kind = first_char(si, PY_NAME("kImportKind"));
  Ref from_kind = first_char(si, PY_NAME("kFromImportKind"));
  Ref plain_kind = first_char(si, PY_NAME("kPlainEquivKind"));
  Ref split = py::getattr(si, PY_NAME("NonNestedSplit"));
  Ref parent_of = py::getattr(si, PY_NAME("ParentScopeName"));
  Ref all_dots = py::getattr(si, PY_NAME("AllDotsInSlice"));
  Ref semicolon = PY_NAME(";"), colon = PY_NAME(":"), space = PY_NAME(" "), star = PY_NAME("*"),
      dot = PY_NAME(".");

  py::for_each(imported_equivs, [&](Borrowed value) {
    Ref text = as_text(value);
    py::for_each(py::call(split, text, semicolon), [&](Borrowed eq_obj) {
      Ref eq = as_text(eq_obj);
      const Py_ssize_t n = PyUnicode_GET_LENGTH(eq.get());
      Ref kind = plain_kind;
      if (n >= 2 && PyUnicode_READ_CHAR(eq.get(), 0) == ':')
        kind = slice(eq, 1, 2);
      if (py::eq(kind, import_kind)) {
        py::set_add(names, slice(eq, prefix_len, n));
        return;
      }
      if (!py::eq(kind, from_kind))
        return;
      Ref body = slice(eq, prefix_len, n);
      Ref parts = py::check(PyUnicode_Split(body.get(), space.get(), -1));
      const Py_ssize_t nparts = PyList_GET_SIZE(parts.get());
      if (nparts < 2)
        return; // no imported name: outside the format
      Borrowed p0(PyList_GET_ITEM(parts.get(), 0)), p1(PyList_GET_ITEM(parts.get(), 1));
      if (py::eq(p1, star)) {
        py::set_add(names, slice(eq, prefix_len, -2));
        return;
      }
      Ref dotted = PY_NAME("");
      if (nparts == 2 && PyUnicode_GET_LENGTH(p0.get()) && PyUnicode_GET_LENGTH(p1.get())) {
        Py_ssize_t ends = PyUnicode_Tailmatch(p0.get(), dot.get(), 0, PY_SSIZE_T_MAX, 1);
        if (ends < 0)
          py::throw_error();
        if (ends) {
          dotted = py::check(PyUnicode_Concat(p0.get(), p1.get()));
        } else {
          Ref with_dot = py::check(PyUnicode_Concat(p0.get(), dot.get()));
          dotted = py::check(PyUnicode_Concat(with_dot.get(), p1.get()));
        }
      }
      while (PyUnicode_GET_LENGTH(dotted.get()) != 0) {
        Ref zero = py::integer(0), len = py::integer(PyUnicode_GET_LENGTH(dotted.get()));
        if (py::truth(py::call(all_dots, dotted, zero, len)))
          break;
        py::set_add(names, dotted);
        dotted = as_text(py::call(parent_of, dotted));
      }
    });
  });
  if (PySet_GET_SIZE(names.get()) == 0)
    return;

  Ref found = py::call_method(factory, PY_NAME("_FindPrimaryLocsForNames"), names, dirloc,
                              Borrowed(Py_False));
  Ref loc_list = py::new_list();
  py::for_each(found, [&](Borrowed loc) {
    if (!loc.is_none())
      py::list_append(loc_list, loc);
  });
  Ref ready = loc_list;
  if (q->f.fAnyAsyncInspectLocation) {
    ready = py::new_list();
    static Ref *s_is_ready = new Ref(PY_NAME("IsReady"));
    for (Py_ssize_t i = 0; i < PyList_GET_SIZE(loc_list.get()); ++i) {
      Borrowed loc(PyList_GET_ITEM(loc_list.get(), i));
      if (py::truth(py::call_method(loc, *s_is_ready)))
        py::list_append(ready, loc);
    }
  }
  Ref mtimes = call::GetModtimeDict(c, ready);
  Ref filtered = py::new_list();
  for (Py_ssize_t i = 0; i < PyList_GET_SIZE(loc_list.get()); ++i) {
    Ref loc = Ref::borrow(PyList_GET_ITEM(loc_list.get(), i));
    Ref t = py::call_method(mtimes, host::names().get, loc);
    if (t.is_none()) {
      py::list_append(filtered, loc);
      continue;
    }
    Ref last = py::dict_get(f._fMTimeAtLastWholeFileCheck, loc);
    int ne = PyObject_RichCompareBool(t.get(), last ? last.get() : Py_None, Py_NE);
    if (ne < 0)
      py::throw_error();
    if (ne)
      py::list_append(filtered, loc);
  }
  if (PyList_GET_SIZE(filtered.get()) == 0)
    return;
  Ref primary = host::anamgr::PrimaryScanName(f.fAnaMgr);
  Ref pairs = py::new_list();
  for (Py_ssize_t i = 0; i < PyList_GET_SIZE(filtered.get()); ++i) {
    Borrowed loc(PyList_GET_ITEM(filtered.get(), i));
    Ref existing = sq::FindScanPriority(q, loc, state->kWildcardScope, primary, Borrowed());
    bool add = !existing || existing.is_none();
    if (!add) {
      int gt = PyObject_RichCompareBool(existing.get(), priority.get(), Py_GT);
      if (gt < 0)
        py::throw_error();
      add = gt != 0;
    }
    if (add)
      py::list_append(pairs, py::check(PyTuple_Pack(2, loc.get(), state->kWildcardScope.get())));
  }
  call::AddPairsToPrimaryQueue(c, pairs, Borrowed(Py_False), priority);
}

Ref GetModtimeDict(C *c, Borrowed loc_seq) {
  Ref times = modtimes_for(c, loc_seq);
  host::objectmodel::emit(self_of(c), PY_NAME("modtimes-updated"), times);
  return times;
}

namespace {

// process_modtimes(abort): bound to the cell (coordinator, loc_seq, completion_cb).
PyObject *process_modtimes(PyObject *cell, PyObject *abort){
    PY_GUARD(nullptr,
             {
               C *c = reinterpret_cast<C *>(PyTuple_GET_ITEM(cell, 0));
               Borrowed loc_seq(PyTuple_GET_ITEM(cell, 1));
               Borrowed completion_cb(PyTuple_GET_ITEM(cell, 2));
               if (py::truth(Borrowed(abort))) {
                 Ref text =
                     py::check(PyUnicode_FromFormat("%s %S\n", kAbortMessage, loc_seq.get()));
                 PyObject *out = PySys_GetObject("stdout");
                 if (out && out != Py_None) {
                   Ref keep = Ref::borrow(out);
                   py::check_int(PyFile_WriteObject(text.get(), keep.get(), Py_PRINT_RAW));
                 }
                 Py_RETURN_NONE;
               }
               Ref times = modtimes_for(c, loc_seq);
               host::objectmodel::emit(self_of(c), PY_NAME("modtimes-updated"), times);
               py::call(completion_cb, times);
               Py_RETURN_NONE;
             })}

PyMethodDef def_process_modtimes = {
  "process_modtimes",
  process_modtimes,
  METH_O,
  nullptr
};

} // namespace

void GetModtimes(C *c, Borrowed loc_seq, Borrowed completion_cb, Borrowed force) {
  Ref cell = py::check(PyTuple_Pack(3, self_of(c).get(), loc_seq.get(), completion_cb.get()));
  Ref cb = py::check(PyCFunction_NewEx(&def_process_modtimes, cell.get(), nullptr));
  Ref wait = py::getattr(host::modules->location, PY_NAME("_WaitForInspectMultiple"));
  py::call(wait, loc_seq, cb, force);
}

} // namespace scancoord::co
