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

// Getter of a py::Ref field; an unset field reads as None.
#define SC_REF_GETTER(Obj, field)                                                                  \
  [](PyObject *self, void *) -> PyObject * {                                                       \
    PyObject *v = reinterpret_cast<Obj *>(self)->f.field.get();                                    \
    return ::py::Ref::borrow(v ? v : Py_None).release();                                           \
  }

} // namespace scancoord
