// pysource.scancoordinator: module initialisation, records and constants.
//
// Initialisation is multi-phase and runs the module body once per process:
//  - create: the first interpreter that loads the module owns it; any other
//    interpreter gets ImportError.  Once the module exists, create hands back
//    that same module, so importing again returns it.
//  - exec: runs the body (imports, records, constants, types) once.  Executing
//    it for a second, different module object raises RuntimeError.
// The body's statements run in the order the host relies on: standard
// modules, host modules, the engine's package modules, CScanItem, the three
// priorities in one update of the globals, the queue types, the status
// records (each followed by its __module__ assignment), the coordinator.
#include "pysource/scancoordinator/module.hpp"
#include "pysource/scancoordinator/types.hpp"
#include "host/hostmodules.hpp"
#include "host/objectmodel.hpp"
#include "host/orderedmap.hpp"

#include <chrono>
#include <cstring>

namespace scancoord {

State *state = nullptr;

namespace {

PyObject *g_module = nullptr; // strong; the process's module, once created
bool g_executed = false;
int64_t g_interp_id = -1;

// ---- records -------------------------------------------------------------

py::Ref namedtuple(py::Borrowed fields_or_names, const char *name, py::Borrowed module_name) {
  py::Ref nt = py::getattr(host::modules->collections, PY_NAME("namedtuple"));
  py::Ref kw = py::check(PyTuple_Pack(1, PY_NAME("module").get()));
  py::Ref tname = py::str(name);
  PyObject *argv[] = {tname.get(), fields_or_names.get(), module_name.get()};
  return py::call_kw(nt, argv, 2, kw);
}

// ---- module-level functions ----------------------------------------------

double now_time() {
  using namespace std::chrono;
  return duration<double>(system_clock::now().time_since_epoch()).count();
}

PyObject *GetNowTime(PyObject *, PyObject *) { return PyFloat_FromDouble(now_time()); }

PyObject *OutOfTime(PyObject *, PyObject *arg) {
  double end_time = PyFloat_AsDouble(arg);
  if (end_time == -1.0 && PyErr_Occurred())
    return nullptr;
  return PyBool_FromLong(now_time() >= end_time);
}

PyMethodDef module_methods[] = {
    {"GetNowTime", GetNowTime, METH_NOARGS,
     "GetNowTime() -> float\n\nThe current wall-clock time in seconds, as time.time()."},
    {"OutOfTime", OutOfTime, METH_O,
     "OutOfTime(end_time) -> bool\n\nTrue when GetNowTime() is at or past end_time."},
    {nullptr, nullptr, 0, nullptr}};

// ---- body ----------------------------------------------------------------

py::Ref import_module(const char *name) { return py::check(PyImport_ImportModule(name)); }

// from <package> import <name>
py::Ref import_from(const char *package, const char *name) {
  py::Ref fromlist = py::check(PyTuple_Pack(1, py::str(name).get()));
  py::Ref pkg = py::check(PyImport_ImportModuleLevel(package, nullptr, nullptr, fromlist.get(), 0));
  return py::getattr(pkg, py::intern(name));
}

void bind(py::Borrowed dict, const char *name, py::Borrowed value) {
  py::check_int(PyDict_SetItemString(dict.get(), name, value.get()));
}

void exec_body(py::Borrowed module) {
  py::Ref dict = py::Ref::borrow(PyModule_GetDict(module.get()));
  py::Ref mod_name = py::getattr(module, PY_NAME("__name__"));
  // The package this module lives in ("pysource" for the engine).
  py::Ref package;
  {
    py::Ref dot = py::str(".");
    py::Ref parts = py::check(PyUnicode_RPartition(mod_name.get(), dot.get()));
    package = py::Ref::borrow(PyTuple_GET_ITEM(parts.get(), 0));
    if (PyUnicode_GetLength(package.get()) == 0)
      package = py::str("pysource");
  }
  const char *pkg = PyUnicode_AsUTF8(package.get());
  if (!pkg)
    py::throw_error();

  auto *m = new host::Modules;
  // The imports, one statement each, in the order the host relies on:
  // standard modules, host modules, then the engine's own package (kOwn).
  // A null package is a plain `import name`; otherwise `from package import name`.
  static const char *const kOwn = "";
  using Slot = py::Ref host::Modules::*;
  const struct {
    const char *package, *name;
    Slot slot;
  } imports[] = {{nullptr, "bisect", &host::Modules::bisect},
                 {nullptr, "collections", &host::Modules::collections},
                 {nullptr, "itertools", &host::Modules::itertools},
                 {nullptr, "sys", &host::Modules::sys},
                 {nullptr, "time", &host::Modules::time},
                 {"cache", "textcache", &host::Modules::textcache},
                 {"guiutils", "ostrelgtk", &host::Modules::ostrelgtk},
                 {"pysource", "logicalline", &host::Modules::logicalline},
                 {"ostrelbase", "destroyable", &host::Modules::destroyable},
                 {"ostrelbase", "location", &host::Modules::location},
                 {"ostrelbase", "mime", &host::Modules::mime},
                 {"ostrelutils", "callutils", &host::Modules::callutils},
                 {"ostrelutils", "reflect", &host::Modules::reflect},
                 {nullptr, "config", &host::Modules::config},
                 {nullptr, "singleton", &host::Modules::singleton},
                 {kOwn, "analysis", &host::Modules::analysis},
                 {kOwn, "inferenceengine", &host::Modules::inferenceengine},
                 {kOwn, "inferencer", &host::Modules::inferencer},
                 {kOwn, "prefs", &host::Modules::prefs},
                 {kOwn, "scopescanner", &host::Modules::scopescanner},
                 {kOwn, "scopeinfo", &host::Modules::scopeinfo},
                 {kOwn, "symbolinfo", &host::Modules::symbolinfo},
                 {kOwn, "usageordereddict", &host::Modules::usageordereddict},
                 {kOwn, "utils", &host::Modules::utils},
                 {kOwn, "_fastaccess", &host::Modules::fastaccess},
                 {kOwn, "strutils", &host::Modules::strutils}};
  for (const auto &imp : imports) {
    if (!imp.package)
      m->*imp.slot = import_module(imp.name);
    else
      m->*imp.slot = import_from(imp.package == kOwn ? pkg : imp.package, imp.name);
    bind(dict, imp.name, m->*imp.slot);
  }
  host::modules = m;
  host::objectmodel::import_base();
  host::orderedmap::import_api();

  auto *st = new State;
  st->module = py::Ref::borrow(module.get());
  py::Ref sys_flags = py::getattr(m->sys, PY_NAME("flags"));
  st->debug = py::as_ll(py::getattr(sys_flags, PY_NAME("optimize"))) == 0;
  st->defaultdict = py::getattr(m->collections, PY_NAME("defaultdict"));
  st->int_type = py::Ref::borrow(reinterpret_cast<PyObject *>(&PyLong_Type));
  st->one = py::integer(1);
  st->kWildcardScope = py::getattr(m->symbolinfo, PY_NAME("kWildcardScope"));
  st->not_found_result = py::check(Py_BuildValue("(OOO)", Py_False, Py_None, Py_None));
  st->waiting_result = py::check(Py_BuildValue("(OOO)", Py_True, Py_None, Py_None));
  state = st;

  // 4. CScanItem
  {
    py::Ref fields =
        py::check(Py_BuildValue("[ssss]", "loc", "scope_name", "scan_name", "priority"));
    st->CScanItem = namedtuple(fields, "CScanItem", mod_name);
    bind(dict, "CScanItem", st->CScanItem);
    st->empty_item = make_scan_item(py::Borrowed(Py_None), py::Borrowed(Py_None),
                                    py::Borrowed(Py_None), py::Borrowed(Py_None));
  }
  // 5. the priorities, published in one update of the globals
  {
    py::Ref update = py::new_dict();
    const char *pnames[] = {"kTypingModulePriority", "kInteractivePriority", "kBackgroundPriority"};
    const long long pvalues[] = {kTypingModulePriority, kInteractivePriority, kBackgroundPriority};
    for (int i = 0; i < 3; ++i) {
      st->priorities[i] = py::integer(pvalues[i]);
      py::check_int(PyDict_SetItemString(update.get(), pnames[i], st->priorities[i].get()));
    }
    py::check_int(PyDict_Update(dict.get(), update.get()));
  }
  // 6. the queue types (kMaxWholeFilesPerCheck is a C constant, not published)
  st->SingleQueueType = create_single_queue_type(module);
  bind(dict, "_CSingleScanQueue", py::Borrowed(reinterpret_cast<PyObject *>(st->SingleQueueType)));
  st->ScanQueueType = create_scan_queue_type(module);
  bind(dict, "_CScanQueue", py::Borrowed(reinterpret_cast<PyObject *>(st->ScanQueueType)));
  // 8. status records
  {
    st->CSingleQueueStatus =
        namedtuple(py::str("scan_name priority file_count"), "CSingleQueueStatus", mod_name);
    bind(dict, "CSingleQueueStatus", st->CSingleQueueStatus);
    py::setattr(st->CSingleQueueStatus, PY_NAME("__module__"), mod_name);
    st->CScanStatus =
        namedtuple(py::str("queue_status_list waiting_count"), "CScanStatus", mod_name);
    bind(dict, "CScanStatus", st->CScanStatus);
    py::setattr(st->CScanStatus, PY_NAME("__module__"), mod_name);
  }
  // 9. the coordinator
  st->CoordinatorType = create_coordinator_type(module);
  bind(dict, "CScanCoordinator", py::Borrowed(reinterpret_cast<PyObject *>(st->CoordinatorType)));
}

PyObject *module_create(PyObject *spec, PyModuleDef *) {
  int64_t id = PyInterpreterState_GetID(PyThreadState_Get()->interp);
  if (id == -1)
    return nullptr;
  if (g_interp_id == -1) {
    g_interp_id = id;
  } else if (g_interp_id != id) {
    PyErr_SetString(PyExc_ImportError, msg::kInterpreterChange);
    return nullptr;
  }
  if (g_module)
    return py::Ref::borrow(g_module).release();
  py::Ref name = py::Ref::steal(PyObject_GetAttrString(spec, "name"));
  if (!name)
    return nullptr;
  PyObject *module = PyModule_NewObject(name.get());
  if (!module)
    return nullptr;
  g_module = py::Ref::borrow(module).release(); // kept for the life of the process
  return module;
}

int module_exec(PyObject *module) {
  if (g_executed) {
    if (module == g_module)
      return 0;
    PyErr_SetString(PyExc_RuntimeError, msg::kReinit);
    return -1;
  }
  if (module != g_module) {
    // Executed for a module object that create did not make.
    PyErr_SetString(PyExc_RuntimeError, msg::kReinit);
    return -1;
  }
  try {
    exec_body(py::Borrowed(module));
    g_executed = true;
    return 0;
  } catch (...) {
    py::translate_exception();
    // Nothing was published; a later import starts again from scratch.
    Py_CLEAR(g_module);
    return -1;
  }
}

PyModuleDef_Slot module_slots[] = {{Py_mod_create, reinterpret_cast<void *>(module_create)},
                                   {Py_mod_exec, reinterpret_cast<void *>(module_exec)},
                                   {0, nullptr}};

PyModuleDef module_def = {
    PyModuleDef_HEAD_INIT,
    "scancoordinator",
    "Scan coordination of the source-analysis engine: priority queues of pending scans,\n"
    "time-sliced idle scanning, synchronous scans for the editor and status reporting.",
    0,
    module_methods,
    module_slots,
    nullptr,
    nullptr,
    nullptr};

} // namespace

// ---- shared helpers ------------------------------------------------------

py::Ref make_scan_item(py::Borrowed loc, py::Borrowed scope, py::Borrowed scan_name,
                       py::Borrowed priority) {
  auto *type = reinterpret_cast<PyTypeObject *>(state->CScanItem.get());
  PyObject *t = type->tp_alloc(type, 4);
  if (!t)
    py::throw_error();
  PyObject *items[] = {loc.get(), scope.get(), scan_name.get(), priority.get()};
  for (int i = 0; i < 4; ++i)
    PyTuple_SET_ITEM(t, i, py::Ref::borrow(items[i]).release());
  return untrack_if_atomic(py::Ref::steal(t));
}

py::Ref item_field(py::Borrowed item, int index) {
  if (PyTuple_Check(item.get()) && PyTuple_GET_SIZE(item.get()) == 4)
    return py::Ref::borrow(PyTuple_GET_ITEM(item.get(), index));
  switch (index) {
  case 0:
    return py::getattr(item, PY_NAME("loc"));
  case 1:
    return py::getattr(item, PY_NAME("scope_name"));
  case 2:
    return py::getattr(item, PY_NAME("scan_name"));
  default:
    return py::getattr(item, PY_NAME("priority"));
  }
}

void assertion_failed(const char *text) {
  if (text)
    PyErr_SetString(PyExc_AssertionError, text);
  else
    PyErr_SetNone(PyExc_AssertionError);
  py::throw_error();
}

PyObject *const *intern_names(const char *const *names, int n) {
  auto *keys = new PyObject *[n > 0 ? n : 1];
  for (int i = 0; i < n; ++i)
    keys[i] = py::intern(names[i]).release();
  return keys;
}

void parse_args(const char *fname, PyObject *const *args, Py_ssize_t nargs, PyObject *kwnames,
                PyObject *const *keys, int required, int total, PyObject **out) {
  for (int i = 0; i < total; ++i)
    out[i] = nullptr;
  if (nargs > total) {
    PyErr_Format(PyExc_TypeError, msg::kArgCount, fname, required == total ? "exactly" : "at most",
                 static_cast<Py_ssize_t>(total), total == 1 ? "" : "s", nargs);
    py::throw_error();
  }
  for (Py_ssize_t i = 0; i < nargs; ++i)
    out[i] = args[i];
  if (kwnames) {
    Py_ssize_t nkw = PyTuple_GET_SIZE(kwnames);
    for (Py_ssize_t k = 0; k < nkw; ++k) {
      PyObject *key = PyTuple_GET_ITEM(kwnames, k);
      int found = -1;
      for (int i = 0; i < total && found < 0; ++i)
        if (key == keys[i])
          found = i;
      for (int i = 0; i < total && found < 0; ++i) {
        // Keyword names are strs (subclasses included): compared as text.
        const int r = PyUnicode_Compare(key, keys[i]);
        if (r == -1 && PyErr_Occurred())
          py::throw_error();
        if (r == 0)
          found = i;
      }
      if (found < 0) {
        PyErr_Format(PyExc_TypeError, msg::kUnexpectedKeyword, fname, key);
        py::throw_error();
      }
      if (out[found]) {
        PyErr_Format(PyExc_TypeError, msg::kDuplicateKeyword, fname, key);
        py::throw_error();
      }
      out[found] = args[nargs + k];
    }
  }
  for (int i = 0; i < required; ++i) {
    if (!out[i]) {
      Py_ssize_t given = nargs;
      PyErr_Format(PyExc_TypeError, msg::kArgCount, fname,
                   required == total ? "exactly" : "at least", static_cast<Py_ssize_t>(required),
                   required == 1 ? "" : "s", given);
      py::throw_error();
    }
  }
}

namespace {
// The ValueError of unpacking `size` values into `n` targets, if they differ.
void check_unpack_size(Py_ssize_t size, Py_ssize_t n) {
  if (size == n)
    return;
  if (size > n)
    PyErr_Format(PyExc_ValueError, msg::kTooManyValues, n);
  else
    PyErr_Format(PyExc_ValueError, msg::kNotEnoughValues, n, size);
  py::throw_error();
}
} // namespace

void unpack(py::Borrowed seq, Py_ssize_t n, py::Ref *out) {
  PyObject *o = seq.get();
  if (PyTuple_CheckExact(o) || PyList_CheckExact(o)) {
    check_unpack_size(PySequence_Fast_GET_SIZE(o), n);
    PyObject **items = PySequence_Fast_ITEMS(o);
    for (Py_ssize_t i = 0; i < n; ++i)
      out[i] = py::Ref::borrow(items[i]);
    return;
  }
  py::Ref it = py::Ref::steal(PyObject_GetIter(o));
  if (!it) {
    if (PyErr_ExceptionMatches(PyExc_TypeError)) {
      PyErr_Clear();
      PyErr_Format(PyExc_TypeError, "cannot unpack non-iterable %.200s object",
                   Py_TYPE(o)->tp_name);
    }
    py::throw_error();
  }
  for (Py_ssize_t i = 0; i < n; ++i) {
    py::Ref v = py::Ref::steal(PyIter_Next(it.get()));
    if (!v) {
      if (!PyErr_Occurred())
        PyErr_Format(PyExc_ValueError, msg::kNotEnoughValues, n, i);
      py::throw_error();
    }
    out[i] = std::move(v);
  }
  py::Ref extra = py::Ref::steal(PyIter_Next(it.get()));
  if (extra) {
    PyErr_Format(PyExc_ValueError, msg::kTooManyValues, n);
    py::throw_error();
  }
  if (PyErr_Occurred())
    py::throw_error();
}

void unpack_tuple(py::Borrowed seq, Py_ssize_t n, py::Ref *out) {
  if (seq.is_none()) {
    // A tuple-typed value may be None; unpacking it is what fails.
    PyErr_SetString(PyExc_TypeError, msg::kNoneNotIterable);
    py::throw_error();
  }
  if (!PyTuple_Check(seq.get())) {
    PyErr_Format(PyExc_TypeError, msg::kExpectedType, "tuple", Py_TYPE(seq.get())->tp_name);
    py::throw_error();
  }
  PyObject *o = seq.get();
  check_unpack_size(PyTuple_GET_SIZE(o), n);
  for (Py_ssize_t i = 0; i < n; ++i)
    out[i] = py::Ref::borrow(PyTuple_GET_ITEM(o, i));
}

namespace {
// getattr(o, name, None) without raising: 1 found, 0 absent, -1 error.
int optional_attr(PyObject *o, const char *name, PyObject **out) {
  *out = PyObject_GetAttrString(o, name);
  if (*out)
    return 1;
  if (PyErr_ExceptionMatches(PyExc_AttributeError)) {
    PyErr_Clear();
    return 0;
  }
  return -1;
}
} // namespace

bool starts_with(py::Borrowed s, py::Borrowed prefix) {
  py::Ref p = prefix.ref();
  if (PyBytes_Check(s.get())) {
    if (PyUnicode_Check(p.get()))
      p = py::check(PyUnicode_AsUTF8String(p.get()));
    if (!PyBytes_Check(p.get()))
      return false;
    const Py_ssize_t n = PyBytes_GET_SIZE(p.get());
    return PyBytes_GET_SIZE(s.get()) >= n &&
           std::memcmp(PyBytes_AS_STRING(s.get()), PyBytes_AS_STRING(p.get()), n) == 0;
  }
  if (PyUnicode_Check(s.get())) {
    if (PyBytes_Check(p.get()))
      p = py::check(PyUnicode_FromEncodedObject(p.get(), "utf-8", "strict"));
    if (!PyUnicode_Check(p.get()))
      return false;
    Py_ssize_t r = PyUnicode_Tailmatch(s.get(), p.get(), 0, PY_SSIZE_T_MAX, -1);
    if (r < 0)
      py::throw_error();
    return r != 0;
  }
  // Any other object (a bytearray, a str subclass's own method...) answers
  // through its own startswith, as Python code would.
  PyObject *attr = nullptr;
  const int found = optional_attr(s.get(), "startswith", &attr);
  if (found < 0)
    py::throw_error();
  if (found == 0)
    return false;
  py::Ref meth = py::Ref::steal(attr);
  return py::truth(py::call(meth, p));
}

py::Ref like(py::Borrowed s, const char *ascii) {
  if (PyBytes_Check(s.get()))
    return py::check(PyBytes_FromString(ascii));
  return py::str(ascii);
}

long long as_int64(py::Borrowed o) {
  if (PyLong_CheckExact(o.get()))
    return py::as_ll(o);
  py::Ref idx = py::check(PyNumber_Index(o.get()));
  return py::as_ll(idx);
}

} // namespace scancoord

PyMODINIT_FUNC PyInit_scancoordinator(void) { return PyModuleDef_Init(&scancoord::module_def); }
