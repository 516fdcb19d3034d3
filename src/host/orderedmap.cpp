// The usage-ordered mapping: exact-type fast path over the capsule, Python
// protocol otherwise.
#include "host/orderedmap.hpp"
#include "host/hostmodules.hpp"

namespace host::orderedmap {

namespace {
const CUsageOrderedDict_CAPI *g_api = nullptr;

bool exact(py::Borrowed d) { return Py_TYPE(d.get()) == g_api->type; }

py::Ref absent_to_empty(py::Ref v) {
  if (v.is_none())
    return py::Ref();
  return v;
}
} // namespace

void import_api() {
  auto *capi = static_cast<const CUsageOrderedDict_CAPI *>(
      PyCapsule_Import(CUSAGEORDEREDDICT_CAPSULE_NAME, 0));
  if (!capi)
    py::throw_error();
  if (capi->abi_version != CUSAGEORDEREDDICT_ABI_VERSION) {
    PyErr_SetString(PyExc_ImportError,
                    "pysource.usageordereddict was built with an incompatible C API");
    py::throw_error();
  }
  g_api = capi;
}

const CUsageOrderedDict_CAPI &api() { return *g_api; }

py::Ref create() {
  // Looked up on the module so that a replacement class is honoured.
  static py::Ref *name = new py::Ref(PY_NAME("CUsageOrderedDict"));
  py::Ref cls = py::getattr(modules->usageordereddict, *name);
  if (cls.get() == reinterpret_cast<PyObject *>(g_api->type))
    return py::check(g_api->create());
  return py::call(cls);
}

py::Ref get(py::Borrowed d, py::Borrowed key, bool first) {
  if (exact(d)) {
    PyObject *v = g_api->get(d.get(), key.get(), first ? 1 : 0);
    if (!v && PyErr_Occurred())
      py::throw_error();
    return py::Ref::borrow(v);
  }
  // Stored values are lists, never None, so None means absent.
  return absent_to_empty(py::call_method(d, names().get, key, py::Borrowed(Py_None),
                                         py::Borrowed(first ? Py_True : Py_False)));
}

py::Ref get(py::Borrowed d, py::Borrowed key) {
  if (exact(d)) {
    PyObject *v = g_api->get(d.get(), key.get(), 0);
    if (!v && PyErr_Occurred())
      py::throw_error();
    return py::Ref::borrow(v);
  }
  return absent_to_empty(py::call_method(d, names().get, key));
}

py::Ref get_likely_first(py::Borrowed d, py::Borrowed key) {
  if (exact(d)) {
    // The first entry holding the very key object is the entry a lookup would
    // find: keys are unique, and a lookup tries identity first.
    PyObject *k = nullptr, *v = nullptr;
    if (g_api->first(d.get(), &k, &v) < 0)
      py::throw_error();
    if (k == key.get())
      return py::Ref::borrow(v);
  }
  return get(d, key);
}

void set(py::Borrowed d, py::Borrowed key, py::Borrowed value, bool first) {
  if (exact(d)) {
    if (g_api->set(d.get(), key.get(), value.get(), first ? 1 : 0) < 0)
      py::throw_error();
    return;
  }
  static py::Ref *kwnames = new py::Ref(py::check(PyTuple_Pack(1, names().first.get())));
  PyObject *argv[] = {d.get(), key.get(), value.get(), first ? Py_True : Py_False};
  py::Ref meth = py::getattr(d, names().Set);
  py::call_kw(meth, argv + 1, 2, *kwnames);
}

py::Ref pop(py::Borrowed d, py::Borrowed key) {
  if (exact(d)) {
    py::Ref v = py::Ref::steal(g_api->pop(d.get(), key.get()));
    if (!v && PyErr_Occurred())
      py::throw_error();
    return v;
  }
  return absent_to_empty(py::call_method(d, names().pop, key, py::Borrowed(Py_None)));
}

void del(py::Borrowed d, py::Borrowed key) {
  if (exact(d)) {
    if (g_api->del(d.get(), key.get()) < 0)
      py::throw_error();
    return;
  }
  py::check_int(PyObject_DelItem(d.get(), key.get()));
}

Py_ssize_t size(py::Borrowed d) {
  if (exact(d))
    return g_api->size(d.get());
  Py_ssize_t n = PyObject_Size(d.get());
  if (n < 0)
    py::throw_error();
  return n;
}

bool first(py::Borrowed d, py::Ref &key, py::Ref &value) {
  if (exact(d)) {
    PyObject *k = nullptr, *v = nullptr;
    if (g_api->first(d.get(), &k, &v) < 0)
      py::throw_error();
    if (!k)
      return false;
    key = py::Ref::borrow(k);
    value = py::Ref::borrow(v);
    return true;
  }
  static py::Ref *s_first = new py::Ref(PY_NAME("_fFirst"));
  static py::Ref *s_key = new py::Ref(PY_NAME("key"));
  static py::Ref *s_val = new py::Ref(PY_NAME("val"));
  py::Ref entry = py::getattr(d, *s_first);
  if (entry.is_none())
    return false;
  key = py::getattr(entry, *s_key);
  value = py::getattr(entry, *s_val);
  return true;
}

py::Ref items(py::Borrowed d) { return py::call_method(d, names().items); }

} // namespace host::orderedmap
