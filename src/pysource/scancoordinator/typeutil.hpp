// Slot helpers shared by the module's heap types.
//
// Each type's instance is `struct Obj { CDestroyableObject base; Fields f; }`.
// Fields provide visit() and clear(); these templates build the GC and
// lifetime slots around them in the order CPython expects:
//   tp_new      base tp_new (allocates, zeroes, sets up the base), then
//               placement-new of the fields;
//   tp_traverse the heap type, our fields, then the base's fields;
//   tp_clear    our fields, then the base's;
//   tp_dealloc  untrack, clear weak references, destroy our fields, let the
//               base free the memory, then release the heap type.
#pragma once

#include "host/objectmodel.hpp"
#include "host/pyref.hpp"

#include <new>

namespace scancoord {

template <typename Obj> PyObject *typed_new(PyTypeObject *type, PyObject *args, PyObject *kwds) {
  PyObject *self = host::objectmodel::base_type()->tp_new(type, args, kwds);
  if (!self)
    return nullptr;
  new (&reinterpret_cast<Obj *>(self)->f) decltype(Obj::f)();
  return self;
}

template <typename Obj> int typed_traverse(PyObject *self, visitproc visit, void *arg) {
  Py_VISIT(Py_TYPE(self));
  if (int r = reinterpret_cast<Obj *>(self)->f.visit(visit, arg))
    return r;
  return host::objectmodel::traverse_base(self, visit, arg);
}

template <typename Obj> int typed_clear(PyObject *self) {
  reinterpret_cast<Obj *>(self)->f.clear();
  return host::objectmodel::clear_base(self);
}

template <typename Obj> void typed_dealloc(PyObject *self) {
  PyTypeObject *type = Py_TYPE(self);
  PyObject_GC_UnTrack(self);
  auto *obj = reinterpret_cast<Obj *>(self);
  if (obj->base.weakreflist)
    PyObject_ClearWeakRefs(self);
  using Fields = decltype(Obj::f);
  obj->f.clear();
  obj->f.~Fields();
  host::objectmodel::dealloc_base(self);
  Py_DECREF(type);
}

// ---- method tables ---------------------------------------------------------

inline PyObject *none() { return py::Ref::none().release(); }
inline PyObject *boolean(bool b) { return py::Ref::of_bool(b).release(); }
inline py::Borrowed arg(PyObject *o) { return py::Borrowed(o); }
inline bool flag(PyObject *o, bool dflt) { return o ? py::truth(py::Borrowed(o)) : dflt; }

// A METH_FASTCALL | METH_KEYWORDS method named m_<name>, its argument parsing,
// and its method-table entry.
#define SC_METHOD(name)                                                                            \
  PyObject *m_##name(PyObject *self, PyObject *const *args, Py_ssize_t nargs, PyObject *kwnames)
#define SC_ARGS(fname, required, ...)                                                              \
  static const char *const names_[] = {__VA_ARGS__};                                               \
  constexpr int total_ = sizeof(names_) / sizeof(names_[0]);                                       \
  static PyObject *const *const keys_ = intern_names(names_, total_);                              \
  PyObject *a[total_];                                                                             \
  parse_args(fname, args, nargs, kwnames, keys_, required, total_, a)
#define SC_NOARGS(fname) parse_args(fname, args, nargs, kwnames, nullptr, 0, 0, nullptr)
#define SC_DEF(name, doc)                                                                          \
  {#name, reinterpret_cast<PyCFunction>(reinterpret_cast<void (*)()>(m_##name)),                   \
   METH_FASTCALL | METH_KEYWORDS, doc}

// ---- overridable dispatch --------------------------------------------------

using FastMethod = PyObject *(*)(PyObject *, PyObject *const *, Py_ssize_t, PyObject *);

// Whether the module's own implementation of `name` applies to `self`: always
// for an instance of `exact` itself (no attribute lookup); for a subclass
// instance when the attribute is still our built-in method bound to it.
// Otherwise `override_out` receives the attribute to call.
inline bool own_method(PyObject *self, PyTypeObject *exact, py::Borrowed name, FastMethod fn,
                       py::Ref &override_out) {
  if (Py_TYPE(self) == exact)
    return true;
  py::Ref meth = py::getattr(py::Borrowed(self), name);
  if (PyCFunction_Check(meth.get()) &&
      reinterpret_cast<void (*)()>(PyCFunction_GET_FUNCTION(meth.get())) ==
          reinterpret_cast<void (*)()>(fn) &&
      PyCFunction_GET_SELF(meth.get()) == self)
    return true;
  override_out = std::move(meth);
  return false;
}

// A heap type of this module derived from the host's destroyable base.
inline PyTypeObject *create_derived_type(py::Borrowed module, PyType_Spec *spec) {
  py::Ref base = py::Ref::borrow(reinterpret_cast<PyObject *>(host::objectmodel::base_type()));
  py::Ref type = py::check(PyType_FromModuleAndSpec(module.get(), spec, base.get()));
  return reinterpret_cast<PyTypeObject *>(type.release()); // kept by the module state
}

// Getter of a py::Ref field; an unset field reads as None.
#define SC_REF_GETTER(Obj, field)                                                                  \
  [](PyObject *self, void *) -> PyObject * {                                                       \
    PyObject *v = reinterpret_cast<Obj *>(self)->f.field.get();                                    \
    return ::py::Ref::borrow(v ? v : Py_None).release();                                           \
  }

} // namespace scancoord
