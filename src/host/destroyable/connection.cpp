// The `_Connection` record: one signal connection or destroy hook.
//
// Owns: the callback (strongly), the signal name, the id, and weak references
// to the emitter and the owner of a while-alive connection.  Created only from
// C++ (the type has no tp_new); seen from Python only as the items of
// `_CDestroyable__fSignalCatchers`.
//
// Invariants:
//   - ids come from one process-wide counter and are never reused, so an id
//     identifies a connection for as long as the process runs;
//   - `active` only goes from true to false;
//   - the record holds no strong reference to its emitter or owner, so the
//     only cycles through it run through its callback, which GC visits;
//   - a class-wide record is out of the registry (which only borrows it)
//     before its callback is dropped and before it is freed.
//
// The C++ fields live after the object header and are constructed with
// placement new on allocation and destroyed in tp_dealloc.
#include "destroyable.hpp"

#include <new>

namespace destroyable {

PyTypeObject Connection_Type = {PyVarObject_HEAD_INIT(nullptr, 0)};

namespace {

long long g_next_id = 1; // only touched with the GIL held

int conn_traverse(PyObject *self, visitproc visit, void *arg) {
  ConnectionFields &f = fields(self);
  for (const py::Ref *r : {&f.signal, &f.callback, &f.emitter, &f.owner})
    if (int rc = r->visit(visit, arg))
      return rc;
  return 0;
}

int conn_clear(PyObject *self) {
  // Only the callback can close a cycle; the rest are strings, ints and weak
  // references.  The record stays usable as a dead connection.
  ConnectionFields &f = fields(self);
  f.active = false;
  unregister_class_connection(self);
  f.callback.reset();
  return 0;
}

void conn_dealloc(PyObject *self) {
  PyObject_GC_UnTrack(self);
  unregister_class_connection(self);
  fields(self).~ConnectionFields();
  Py_TYPE(self)->tp_free(self);
}

py::Ref repr_impl(PyObject *self) {
  ConnectionFields &f = fields(self);
  const char *state = f.active ? "" : " ended";
  if (f.kind == Kind::Hook)
    return py::check(PyUnicode_FromFormat("<_Connection %lld: destroy hook%s>", f.id, state));
  return py::check(PyUnicode_FromFormat("<_Connection %lld: %R%s%s>", f.id, f.signal.get(),
                                        f.kind == Kind::Class ? " (class-wide)" : "", state));
}

PyObject *conn_repr(PyObject *self) { PY_GUARD(nullptr, return repr_impl(self).release();) }

} // namespace

int ready_connection_type() {
  PyTypeObject &t = Connection_Type;
  if (t.tp_flags & Py_TPFLAGS_READY)
    return 0;
  t.tp_name = "ostrelbase.destroyable._Connection";
  t.tp_doc = "A signal connection or destroy hook of a CDestroyable (internal).";
  t.tp_basicsize = sizeof(ConnectionObject);
  t.tp_flags = Py_TPFLAGS_DEFAULT | Py_TPFLAGS_HAVE_GC;
  t.tp_dealloc = conn_dealloc;
  t.tp_traverse = conn_traverse;
  t.tp_clear = conn_clear;
  t.tp_repr = conn_repr;
  t.tp_free = PyObject_GC_Del;
  return PyType_Ready(&t);
}

py::Ref new_connection(Kind kind, py::Borrowed signal, py::Borrowed callback, py::Borrowed emitter,
                       py::Borrowed owner) {
  // Everything that can fail is made before the object exists.
  py::Ref id_obj = py::integer(g_next_id);
  py::Ref emitter_wr, owner_wr;
  if (emitter)
    emitter_wr = py::check(PyWeakref_NewRef(emitter.get(), nullptr));
  if (owner)
    owner_wr = py::check(PyWeakref_NewRef(owner.get(), nullptr));

  ConnectionObject *c = PyObject_GC_New(ConnectionObject, &Connection_Type);
  if (!c)
    py::throw_error();
  ConnectionFields *f = new (&c->f) ConnectionFields();
  py::Ref result = py::Ref::steal(reinterpret_cast<PyObject *>(c));
  f->id = g_next_id++;
  f->kind = kind;
  f->id_obj = std::move(id_obj);
  f->signal = signal;
  f->callback = callback;
  f->emitter = std::move(emitter_wr);
  f->owner = std::move(owner_wr);
  PyObject_GC_Track(result.get());
  return result;
}

py::Ref deref(const py::Ref &weakref) {
  if (!weakref)
    return py::Ref();
  PyObject *o = PyWeakref_GetObject(weakref.get());
  if (!o)
    py::throw_error();
  if (o == Py_None || Py_REFCNT(o) <= 0)
    return py::Ref();
  return py::Ref::borrow(o);
}

} // namespace destroyable
