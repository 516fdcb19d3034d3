// Object model and signals: capsule import and the thin wrappers over the
// destroyable base class's C entry points.
#include "host/objectmodel.hpp"
#include "host/hostmodules.hpp"

namespace host::objectmodel {

namespace {
const CDestroyable_CAPI *g_api = nullptr;
constexpr const char *kLayoutMismatch =
    "ostrelbase.destroyable was built with an incompatible CDestroyable layout";
} // namespace

void import_base() {
  auto *capi =
      static_cast<const CDestroyable_CAPI *>(PyCapsule_Import(CDESTROYABLE_CAPSULE_NAME, 0));
  if (!capi)
    py::throw_error();
  if (capi->abi_version != CDESTROYABLE_ABI_VERSION ||
      capi->object_size != sizeof(CDestroyableObject) ||
      capi->type->tp_basicsize != static_cast<Py_ssize_t>(sizeof(CDestroyableObject))) {
    PyErr_SetString(PyExc_ImportError, kLayoutMismatch);
    py::throw_error();
  }
  g_api = capi;
}

PyTypeObject *base_type() { return g_api->type; }
const CDestroyable_CAPI &api() { return *g_api; }

void base_init(py::Borrowed self, py::Borrowed signals) {
  if (g_api->init(self.get(), signals.get()) < 0)
    py::throw_error();
}

py::Ref connect_while_alive(py::Borrowed emitter, py::Borrowed signal, py::Borrowed callback,
                            py::Borrowed owner) {
  if (PyObject_TypeCheck(emitter.get(), g_api->type))
    return py::check(
        g_api->connect_while_alive(emitter.get(), signal.get(), callback.get(), owner.get()));
  // A host object that is not a CDestroyable but offers the same method.
  return py::call_method(emitter, names().connect_while_alive, signal, callback, owner);
}

void destroy(py::Borrowed obj) {
  // The C entry point only when obj.destroy is the base class's own method;
  // a host class that overrides destroy() gets its override called.
  static PyObject *base_destroy = nullptr; // borrowed from the base type's dict
  if (!base_destroy) {
    base_destroy = PyDict_GetItemWithError(g_api->type->tp_dict, names().destroy.get());
    if (!base_destroy && PyErr_Occurred())
      py::throw_error();
  }
  bool own_destroy = false;
  if (PyObject_TypeCheck(obj.get(), g_api->type)) {
    if (Py_TYPE(obj.get()) == g_api->type) {
      own_destroy = true;
    } else {
      // The type's own attribute, found through the type's method cache.
      own_destroy = _PyType_Lookup(Py_TYPE(obj.get()), names().destroy.get()) == base_destroy;
    }
  }
  if (own_destroy) {
    if (g_api->destroy(obj.get()) < 0)
      py::throw_error();
    return;
  }
  py::call_method(obj, names().destroy);
}

int traverse_base(PyObject *self, visitproc visit, void *arg) {
  return g_api->type->tp_traverse(self, visit, arg);
}
int clear_base(PyObject *self) { return g_api->type->tp_clear(self); }
void dealloc_base(PyObject *self) { g_api->type->tp_dealloc(self); }

} // namespace host::objectmodel
