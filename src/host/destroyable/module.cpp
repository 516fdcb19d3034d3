// ostrelbase.destroyable: the Python face of CDestroyable and the module.
//
// Owns the static type CDestroyable (instance layout CDestroyableObject from
// host/destroyable_capi.h), its slots and method/getset tables, the capsule
// `_C_API` (a CDestroyable_CAPI table with static storage) and the module
// init.  The behaviour behind every entry is in destroyable.cpp; each entry
// here only unpacks arguments and turns C++ exceptions back into Python
// ones (PY_GUARD).
//
// Chaining from derived types.  Heap types in other extension modules derive
// from this static type and chain to its GC slots, so the base slots touch
// only the base part of the layout and never the type object:
//
//   tp_traverse  visits the base fields only, NOT Py_TYPE(self) (the base
//                type is static).  A derived heap type visits Py_TYPE(self)
//                once, then its own fields, then returns the base's result:
//                  Py_VISIT(Py_TYPE(self)); Py_VISIT(own...);
//                  return capi->type->tp_traverse(self, visit, arg);
//   tp_clear     ends and drops the base's connections, hooks and handlers;
//                the declared signals stay (they cannot form a cycle).  A
//                derived type clears its own fields, then chains.
//   tp_dealloc   untracks (harmless if the caller already did), clears any
//                weak references left, ends and drops the base fields, then
//                calls Py_TYPE(self)->tp_free(self).  It never touches the
//                type's reference count.  A derived heap type does:
//                  PyTypeObject *tp = Py_TYPE(self);
//                  PyObject_GC_UnTrack(self); clear own fields;
//                  capi->type->tp_dealloc(self);   // frees self
//                  Py_DECREF(tp);
//                Python subclasses get exactly this from subtype_dealloc.
//
// The base slots never take a reference to self (it may have none left), and
// they keep a pending exception intact.
//
// Instances have weak references (weakreflist) and no __dict__; a Python
// subclass adds its own __dict__ as usual.
#include "destroyable.hpp"

#include <cstddef>

namespace destroyable {

PyTypeObject CDestroyable_Type = {PyVarObject_HEAD_INIT(nullptr, 0)};

namespace {

// ---- GC and lifetime slots -----------------------------------------------------

int d_traverse(PyObject *self, visitproc visit, void *arg) {
  CDestroyableObject *d = as_destroyable(self);
  Py_VISIT(d->declared_signals);
  Py_VISIT(d->signal_catchers);
  Py_VISIT(d->owned);
  return 0;
}

int d_clear(PyObject *self) {
  clear_state(as_destroyable(self), false);
  return 0;
}

void d_dealloc(PyObject *self) {
  PyObject_GC_UnTrack(self);
  if (as_destroyable(self)->weakreflist)
    PyObject_ClearWeakRefs(self);
  clear_state(as_destroyable(self), true);
  Py_TYPE(self)->tp_free(self);
}

int d_init(PyObject *self, PyObject *args, PyObject *kwds) {
  static const char *kwlist[] = {"signals", nullptr};
  PyObject *signals = nullptr;
  if (!PyArg_ParseTupleAndKeywords(args, kwds, "|O:__init__", const_cast<char **>(kwlist),
                                   &signals))
    return -1;
  PY_GUARD(-1, init(as_destroyable(self), py::Borrowed(signals)); return 0;)
}

// ---- methods -------------------------------------------------------------------

PyObject *m_connect(PyObject *self, PyObject *args, PyObject *kwds) {
  static const char *kwlist[] = {"signal", "callback", nullptr};
  PyObject *signal, *callback;
  if (!PyArg_ParseTupleAndKeywords(args, kwds, "OO:connect", const_cast<char **>(kwlist), &signal,
                                   &callback))
    return nullptr;
  PY_GUARD(
      nullptr,
      return connect(as_destroyable(self), py::Borrowed(signal), py::Borrowed(callback)).release();)
}

PyObject *m_connect_while_alive(PyObject *self, PyObject *args, PyObject *kwds) {
  static const char *kwlist[] = {"signal", "callback", "owner", nullptr};
  PyObject *signal, *callback, *owner;
  if (!PyArg_ParseTupleAndKeywords(args, kwds, "OOO:connect_while_alive",
                                   const_cast<char **>(kwlist), &signal, &callback, &owner))
    return nullptr;
  PY_GUARD(nullptr, return connect_while_alive(as_destroyable(self), py::Borrowed(signal),
                                               py::Borrowed(callback), py::Borrowed(owner))
                        .release();)
}

PyObject *m_disconnect(PyObject *self, PyObject *args, PyObject *kwds) {
  static const char *kwlist[] = {"id", nullptr};
  PyObject *id;
  if (!PyArg_ParseTupleAndKeywords(args, kwds, "O:disconnect", const_cast<char **>(kwlist), &id))
    return nullptr;
  PY_GUARD(nullptr, disconnect(as_destroyable(self), py::Borrowed(id)); Py_RETURN_NONE;)
}

PyObject *m_class_connect_while_alive(PyObject *cls, PyObject *args, PyObject *kwds) {
  static const char *kwlist[] = {"signal", "callback", "owner", nullptr};
  PyObject *signal, *callback, *owner;
  if (!PyArg_ParseTupleAndKeywords(args, kwds, "OOO:class_connect_while_alive",
                                   const_cast<char **>(kwlist), &signal, &callback, &owner))
    return nullptr;
  PY_GUARD(nullptr, return class_connect_while_alive(reinterpret_cast<PyTypeObject *>(cls),
                                                     py::Borrowed(signal), py::Borrowed(callback),
                                                     py::Borrowed(owner))
                        .release();)
}

PyObject *m_class_disconnect(PyObject *, PyObject *args, PyObject *kwds) {
  static const char *kwlist[] = {"id", nullptr};
  PyObject *id;
  if (!PyArg_ParseTupleAndKeywords(args, kwds, "O:class_disconnect", const_cast<char **>(kwlist),
                                   &id))
    return nullptr;
  PY_GUARD(nullptr, class_disconnect(py::Borrowed(id)); Py_RETURN_NONE;)
}

// The hot path: positional only, the arguments go to the handlers as they are.
PyObject *m_emit(PyObject *self, PyObject *const *args, Py_ssize_t nargs) {
  if (nargs < 1) {
    PyErr_SetString(PyExc_TypeError, msg::kEmitWithoutSignal);
    return nullptr;
  }
  PY_GUARD(nullptr, emit(as_destroyable(self), py::Borrowed(args[0]), args + 1, nargs - 1);
           Py_RETURN_NONE;)
}

PyObject *m_destroy(PyObject *self, PyObject *) {
  PY_GUARD(nullptr, destroy(as_destroyable(self)); Py_RETURN_NONE;)
}

PyObject *m_destroy_impl(PyObject *, PyObject *) { Py_RETURN_NONE; }

PyObject *m_register_destroy_hook(PyObject *self, PyObject *hook) {
  PY_GUARD(nullptr,
           return register_destroy_hook(as_destroyable(self), py::Borrowed(hook)).release();)
}

PyObject *m_unregister_destroy_hook(PyObject *self, PyObject *token) {
  PY_GUARD(nullptr, unregister_destroy_hook(as_destroyable(self), py::Borrowed(token));
           Py_RETURN_NONE;)
}

template <typename F> PyCFunction fn(F f) {
  return reinterpret_cast<PyCFunction>(reinterpret_cast<void (*)(void)>(f));
}

PyMethodDef d_methods[] = {
    {"connect", fn(m_connect), METH_VARARGS | METH_KEYWORDS,
     "connect(signal, callback) -> id\n\n"
     "Call callback with the signal's arguments whenever this object emits\n"
     "signal.  The id is unique in the process; pass it to disconnect()."},
    {"disconnect", fn(m_disconnect), METH_VARARGS | METH_KEYWORDS,
     "disconnect(id)\n\nRemove a connection of this object.  An unknown id is ignored."},
    {"connect_while_alive", fn(m_connect_while_alive), METH_VARARGS | METH_KEYWORDS,
     "connect_while_alive(signal, callback, owner) -> id or None\n\n"
     "As connect(), and the connection ends when owner (a CDestroyable) is\n"
     "destroyed.  When owner is already destroyed, nothing is connected and\n"
     "None is returned."},
    {"class_connect_while_alive", fn(m_class_connect_while_alive),
     METH_VARARGS | METH_KEYWORDS | METH_CLASS,
     "class_connect_while_alive(signal, callback, owner) -> id or None\n\n"
     "Call callback for signal as emitted by any instance of this class or of\n"
     "its subclasses, until owner is destroyed.  Called after the emitting\n"
     "instance's own handlers."},
    {"class_disconnect", fn(m_class_disconnect), METH_VARARGS | METH_KEYWORDS | METH_CLASS,
     "class_disconnect(id)\n\nRemove a class-wide connection.  An unknown id is ignored."},
    {"emit", fn(m_emit), METH_FASTCALL,
     "emit(signal, *args)\n\n"
     "Call every handler of signal with args: this object's connections in\n"
     "connection order, then the class-wide ones from the most derived class.\n"
     "Handlers connected meanwhile are not called by this emission; handlers\n"
     "disconnected meanwhile are not called after that.  A handler's\n"
     "exception propagates at once."},
    {"destroy", fn(m_destroy), METH_NOARGS,
     "destroy()\n\n"
     "Tear the object down once: run _destroy_impl(), end every connection\n"
     "and hook this object owns, then drop the handlers of its own signals.\n"
     "Later calls do nothing."},
    {"_destroy_impl", fn(m_destroy_impl), METH_NOARGS,
     "_destroy_impl()\n\nOverride to release the subclass's own state; called once by destroy()."},
    {"_register_destroy_hook", fn(m_register_destroy_hook), METH_O,
     "_register_destroy_hook(callable) -> token or None\n\n"
     "Call callable() when this object is destroyed (at once, returning None,\n"
     "if it already is)."},
    {"_unregister_destroy_hook", fn(m_unregister_destroy_hook), METH_O,
     "_unregister_destroy_hook(token)\n\nCancel a destroy hook.  An unknown token is ignored."},
    {nullptr, nullptr, 0, nullptr},
};

// ---- the private fields, read-only under their mangled names ----------------------

PyObject *get_always_main(PyObject *self, void *) {
  return py::Ref::of_bool(as_destroyable(self)->always_destroy_on_main_thread).release();
}
PyObject *get_destroyed(PyObject *self, void *) {
  return py::Ref::of_bool(as_destroyable(self)->destroyed).release();
}
PyObject *get_catchers(PyObject *self, void *) {
  PyObject *catchers = as_destroyable(self)->signal_catchers;
  return (catchers ? py::Ref::borrow(catchers) : py::Ref::none()).release();
}

PyGetSetDef d_getset[] = {
    {"_CDestroyable__fAlwaysDestroyOnMainThread", get_always_main, nullptr,
     "Whether destroy() must run on the main thread (always False here).", nullptr},
    {"_CDestroyable__fDestroyed", get_destroyed, nullptr, "True once destroy() has started.",
     nullptr},
    {"_CDestroyable__fSignalCatchers", get_catchers, nullptr,
     "dict: signal -> list of connections, or None before the first connection.", nullptr},
    {nullptr, nullptr, nullptr, nullptr, nullptr},
};

int ready_destroyable_type() {
  PyTypeObject &t = CDestroyable_Type;
  if (t.tp_flags & Py_TPFLAGS_READY)
    return 0;
  t.tp_name = "ostrelbase.destroyable.CDestroyable";
  t.tp_doc = "CDestroyable(signals=())\n\n"
             "Base class of the host's objects: named signals with synchronous\n"
             "handlers, connections that end with an owner, and an explicit,\n"
             "idempotent destroy().  signals names the signals instances may emit.";
  t.tp_basicsize = sizeof(CDestroyableObject);
  t.tp_flags = Py_TPFLAGS_DEFAULT | Py_TPFLAGS_BASETYPE | Py_TPFLAGS_HAVE_GC;
  t.tp_weaklistoffset = offsetof(CDestroyableObject, weakreflist);
  t.tp_new = PyType_GenericNew; // ignores arguments: subclasses' __init__ owns them
  t.tp_init = d_init;
  t.tp_dealloc = d_dealloc;
  t.tp_traverse = d_traverse;
  t.tp_clear = d_clear;
  t.tp_free = PyObject_GC_Del;
  t.tp_methods = d_methods;
  t.tp_getset = d_getset;
  return PyType_Ready(&t);
}

// ---- the C API -------------------------------------------------------------------

CDestroyableObject *require_instance(PyObject *self) {
  if (!is_destroyable(self)) {
    PyErr_Format(PyExc_TypeError, msg::kNotDestroyable, Py_TYPE(self)->tp_name);
    py::throw_error();
  }
  return as_destroyable(self);
}

int capi_init(PyObject *self, PyObject *signals) {
  PY_GUARD(-1, init(require_instance(self), py::Borrowed(signals)); return 0;)
}

int capi_emit(PyObject *self, PyObject *signal, PyObject *const *args, Py_ssize_t nargs) {
  PY_GUARD(-1, emit(require_instance(self), py::Borrowed(signal), args, nargs); return 0;)
}

PyObject *capi_connect_while_alive(PyObject *self, PyObject *signal, PyObject *callback,
                                   PyObject *owner) {
  PY_GUARD(nullptr, return connect_while_alive(require_instance(self), py::Borrowed(signal),
                                               py::Borrowed(callback), py::Borrowed(owner))
                        .release();)
}

int capi_destroy(PyObject *self) { PY_GUARD(-1, destroy(require_instance(self)); return 0;) }

int capi_is_destroyed(PyObject *self) {
  return is_destroyable(self) && as_destroyable(self)->destroyed ? 1 : 0;
}

CDestroyable_CAPI g_capi = {
    CDESTROYABLE_ABI_VERSION,
    sizeof(CDestroyableObject),
    &CDestroyable_Type,
    capi_init,
    capi_emit,
    capi_connect_while_alive,
    capi_destroy,
    capi_is_destroyed,
};

// ---- test-only accessors ------------------------------------------------------------

PyObject *debug_owned_count(PyObject *, PyObject *obj) {
  PY_GUARD(nullptr, return py::integer(owned_count(require_instance(obj))).release();)
}

PyObject *debug_class_registry_size(PyObject *, PyObject *) {
  PY_GUARD(nullptr, return py::integer(static_cast<long long>(class_registry_size())).release();)
}

PyMethodDef module_methods[] = {
    {"_debug_owned_count", debug_owned_count, METH_O,
     "Number of records an object keeps as an owner (test support)."},
    {"_debug_class_registry_size", debug_class_registry_size, METH_NOARGS,
     "Number of classes with class-wide connections (test support)."},
    {nullptr, nullptr, 0, nullptr},
};

PyModuleDef module_def = {
    PyModuleDef_HEAD_INIT,
    "ostrelbase.destroyable",
    "The host's destroyable base class CDestroyable and its C API capsule _C_API.",
    -1,
    module_methods,
};

// The type is ready before the capsule that hands it out exists; the module
// object is only returned whole (a failure drops everything made so far).
py::Ref create_module() {
  py::Ref module = py::check(PyModule_Create(&module_def));
  py::check_int(PyModule_AddObjectRef(module.get(), "CDestroyable",
                                      reinterpret_cast<PyObject *>(&CDestroyable_Type)));
  py::Ref capsule = py::check(PyCapsule_New(&g_capi, CDESTROYABLE_CAPSULE_NAME, nullptr));
  py::check_int(PyModule_AddObjectRef(module.get(), "_C_API", capsule.get()));
  return module;
}

} // namespace
} // namespace destroyable

PyMODINIT_FUNC PyInit_destroyable(void) {
  using namespace destroyable;
  // Readying the types and the globals is idempotent, so a failed import can
  // simply be retried.
  if (ready_connection_type() < 0 || ready_destroyable_type() < 0 || init_globals() < 0)
    return nullptr;
  PY_GUARD(nullptr, return create_module().release();)
}
