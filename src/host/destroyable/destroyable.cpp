// The logic of CDestroyable: declared signals, connections, emission,
// destruction and the class-wide registry.  The Python face (slots, method
// tables, capsule) is in module.cpp.
//
// Data structures (the raw fields are those of CDestroyableObject):
//
//   declared_signals  tuple of interned exact str, or NULL before __init__
//                     (no signal declared).  Checked by connect,
//                     connect_while_alive and emit.
//   signal_catchers   dict: signal -> list of _Connection, in connection
//                     order, keyed by the declared names themselves (exact
//                     interned str, so lookups run no Python code).  NULL
//                     until the first connection.  A list is removed when it
//                     empties, so a miss is the common "nobody listens" case.
//   owned             dict: id -> _Connection, in registration order.  What
//                     this object ends when it is destroyed: its while-alive
//                     connections on other objects (instance or class-wide)
//                     and its destroy hooks.  NULL until first needed.
//   class registry    a process-wide C++ map: type -> {weakref to the type,
//                     vector of class-wide _Connection in connection order}.
//                     The vector BORROWS its records: the owner's `owned`
//                     holds each one, and a record leaves the registry before
//                     it loses its callback or dies.  So the registry holds no
//                     Python reference that GC cannot see, and an owner
//                     dropped without destroy() is still collectable.  An
//                     entry lives while it has connections and its type
//                     lives; the weakref's callback drops it with the type.
//
// An instance while-alive connection is referenced strongly from both ends
// (the emitter's list and the owner's `owned`) and reaches each end only
// through a weakref.  Whichever end lets go first removes the other end's
// reference at once:
//   - disconnect / class_disconnect, the emitter's destroy(), the emitter or
//     its class dying        -> forget_on_owner() pops the owner's record;
//   - the owner's destroy(), or the owner going away without destroy()
//                            -> end_on_emitter() removes the handler.
// So neither side keeps the other alive, and `owned` holds exactly the live
// while-alive connections and hooks: it cannot grow over a long run.
//
// Reentrancy.  Handlers, hooks, _destroy_impl and any DECREF can run Python
// code, which can connect, disconnect, emit or destroy anything.  So:
//   - emit() collects every handler it will call (instance, then class-wide)
//     into a snapshot of strong references before calling the first one, and
//     skips a record whose `active` flag was cleared in the meantime;
//   - code that walks a container copies what it needs into strong
//     references before anything that can call out, and never holds a
//     borrowed item or a registry iterator across such a call;
//   - a field is detached from the object before its contents are released
//     (take_field), so code run by a finaliser sees the new state.
#include "destroyable.hpp"

#include <array>
#include <memory>
#include <unordered_map>
#include <vector>

namespace destroyable {

namespace {

// ---- module-lifetime globals ----------------------------------------------
// Allocated once at module init and deliberately never freed: their
// destructors would run after the interpreter is gone.
struct ClassEntry {
  py::Ref type_weakref;          // with class_gone as callback
  std::vector<PyObject *> conns; // borrowed class-wide _Connection records
};
using Registry = std::unordered_map<PyTypeObject *, ClassEntry>;

struct Globals {
  py::Ref destroy_impl_name;
  py::Ref class_gone; // builtin function: the registry weakrefs' callback
  Registry registry;
};
Globals *g = nullptr;

Registry &registry() { return g->registry; }

PyObject *class_gone(PyObject *, PyObject *weakref) {
  PY_GUARD(nullptr, forget_class(py::Borrowed(weakref)); Py_RETURN_NONE;)
}

PyMethodDef class_gone_def = {"_class_gone", class_gone, METH_O,
                              "Drop the class-wide connections of a class that died."};

// ---- small helpers -----------------------------------------------------------

PyObject *as_object(CDestroyableObject *self) { return reinterpret_cast<PyObject *>(self); }

// Store a new value in a raw field; the old value is released after the
// field is updated.
void set_field(PyObject *&slot, py::Ref value) {
  py::Ref old = py::Ref::steal(slot);
  slot = value.release();
}

// Detach a raw field from the object and hand over its reference.
py::Ref take_field(PyObject *&slot) {
  py::Ref old = py::Ref::steal(slot);
  slot = nullptr;
  return old;
}

// Sets aside the pending exception (tp_dealloc can run while one propagates)
// and puts it back on scope exit.
class ErrorStash {
public:
  ErrorStash() { PyErr_Fetch(&type_, &value_, &tb_); }
  ~ErrorStash() { PyErr_Restore(type_, value_, tb_); }
  ErrorStash(const ErrorStash &) = delete;
  ErrorStash &operator=(const ErrorStash &) = delete;

private:
  PyObject *type_, *value_, *tb_;
};

// Teardown goes on past errors: the first is kept to be raised at the end,
// later ones go to sys.unraisablehook so that none is silently lost.
class FirstError {
public:
  template <typename F> void run(F &&step, PyObject *context) noexcept {
    try {
      step();
    } catch (...) {
      py::translate_exception();
      keep(context);
    }
  }
  void rethrow() {
    if (!type_)
      return;
    PyErr_Restore(type_.release(), value_.release(), tb_.release());
    py::throw_error();
  }
  void write_unraisable() noexcept {
    if (!type_)
      return;
    PyErr_Restore(type_.release(), value_.release(), tb_.release());
    PyErr_WriteUnraisable(nullptr);
  }

private:
  void keep(PyObject *context) noexcept {
    if (type_) {
      PyErr_WriteUnraisable(context);
      return;
    }
    PyObject *t, *v, *tb;
    PyErr_Fetch(&t, &v, &tb);
    type_ = py::Ref::steal(t);
    value_ = py::Ref::steal(v);
    tb_ = py::Ref::steal(tb);
  }
  py::Ref type_, value_, tb_;
};

// The handlers one emission calls.  Most signals have at most a handful, so
// the first few live inline and emitting to them allocates nothing.
class Snapshot {
public:
  void add_list(PyObject *list) {
    if (!PyList_Check(list))
      return;
    for (Py_ssize_t i = 0; i < PyList_GET_SIZE(list); ++i) {
      PyObject *item = PyList_GET_ITEM(list, i);
      if (is_connection(item))
        add(item);
    }
  }
  std::size_t size() const { return n_; }
  PyObject *operator[](std::size_t i) const {
    return i < kInline ? inline_[i].get() : heap_[i - kInline].get();
  }
  void add(PyObject *item) {
    if (n_ < kInline)
      inline_[n_] = py::Ref::borrow(item);
    else
      heap_.push_back(py::Ref::borrow(item));
    ++n_;
  }

private:
  static constexpr std::size_t kInline = 4;
  std::array<py::Ref, kInline> inline_;
  std::vector<py::Ref> heap_;
  std::size_t n_ = 0;
};

// Every _Connection in a dict signal -> list, in signal then connection order.
std::vector<py::Ref> all_connections(PyObject *catchers) {
  std::vector<py::Ref> out;
  Py_ssize_t pos = 0;
  PyObject *key, *list;
  while (PyDict_Next(catchers, &pos, &key, &list)) {
    if (!PyList_Check(list))
      continue;
    for (Py_ssize_t i = 0; i < PyList_GET_SIZE(list); ++i)
      if (is_connection(PyList_GET_ITEM(list, i)))
        out.push_back(py::Ref::borrow(PyList_GET_ITEM(list, i)));
  }
  return out;
}

// The values of `owned`, in registration order.
std::vector<py::Ref> owned_records(PyObject *owned) {
  std::vector<py::Ref> out;
  Py_ssize_t pos = 0;
  PyObject *key, *value;
  while (PyDict_Next(owned, &pos, &key, &value))
    if (is_connection(value))
      out.push_back(py::Ref::borrow(value));
  return out;
}

// An id handed back by a caller.  Anything that is not one of our ints
// (None from a connection that was never made, a stale value) matches
// nothing, which makes disconnecting it a no-op.
bool id_value(py::Borrowed id, long long *out) {
  if (!PyLong_Check(id.get()))
    return false;
  int overflow = 0;
  long long v = PyLong_AsLongLongAndOverflow(id.get(), &overflow);
  if (v == -1 && PyErr_Occurred()) {
    PyErr_Clear();
    return false;
  }
  if (overflow)
    return false;
  *out = v;
  return true;
}

// The connection with this id among the lists of `catchers`.  Calls no
// Python code.
py::Ref find_by_id(PyObject *catchers, long long id) {
  Py_ssize_t pos = 0;
  PyObject *key, *list;
  while (PyDict_Next(catchers, &pos, &key, &list)) {
    if (!PyList_Check(list))
      continue;
    for (Py_ssize_t i = 0; i < PyList_GET_SIZE(list); ++i) {
      PyObject *item = PyList_GET_ITEM(list, i);
      if (is_connection(item) && fields(item).id == id)
        return py::Ref::borrow(item);
    }
  }
  return py::Ref();
}

// catchers[signal].append(conn)
void add_handler(py::Borrowed catchers, py::Borrowed signal, py::Borrowed conn) {
  py::Ref list = py::dict_get(catchers, signal);
  if (list && PyList_Check(list.get())) {
    py::list_append(list, conn);
    return;
  }
  list = py::new_list(0);
  py::list_append(list, conn);
  py::dict_set(catchers, signal, list);
}

// Remove conn (by identity) from catchers[signal]; an emptied list goes.
// The caller holds conn, so removing it runs no Python code.
void remove_handler(py::Borrowed catchers, py::Borrowed signal, PyObject *conn) {
  py::Ref list = py::dict_get(catchers, signal);
  if (!list || !PyList_Check(list.get()))
    return;
  for (Py_ssize_t i = 0; i < PyList_GET_SIZE(list.get()); ++i) {
    if (PyList_GET_ITEM(list.get(), i) == conn) {
      py::check_int(PyList_SetSlice(list.get(), i, i + 1, nullptr));
      break;
    }
  }
  if (PyList_GET_SIZE(list.get()) == 0)
    py::dict_del(catchers, signal);
}

// Signal names are compared as strings, never through __eq__, so matching
// runs no Python code.
bool same_signal(PyObject *a, PyObject *b) {
  return a == b || (PyUnicode_Check(a) && PyUnicode_Check(b) && PyUnicode_Compare(a, b) == 0);
}

// An exact, interned copy of a signal name: emit compares by identity first.
py::Ref signal_name(PyObject *item) {
  if (!PyUnicode_Check(item)) {
    PyErr_Format(PyExc_TypeError, msg::kSignalNameNotStr, Py_TYPE(item)->tp_name);
    py::throw_error();
  }
  PyObject *name = py::check(PyUnicode_FromObject(item)).release();
  PyUnicode_InternInPlace(&name);
  return py::Ref::steal(name);
}

// The declared name equal to `signal` (borrowed from the declared tuple), or
// a ValueError.  Handler lists are keyed by these exact, interned names, so
// looking one up never runs a __hash__ or __eq__ of the caller's object.
PyObject *declared_name(CDestroyableObject *self, PyObject *signal) {
  if (PyObject *declared = self->declared_signals) {
    const Py_ssize_t n = PyTuple_GET_SIZE(declared);
    // Callers mostly pass literals, so identity nearly always decides;
    // equality covers the rest.
    for (Py_ssize_t i = 0; i < n; ++i)
      if (PyTuple_GET_ITEM(declared, i) == signal)
        return signal;
    if (PyUnicode_Check(signal))
      for (Py_ssize_t i = 0; i < n; ++i)
        if (PyUnicode_Compare(PyTuple_GET_ITEM(declared, i), signal) == 0)
          return PyTuple_GET_ITEM(declared, i);
  }
  py::Ref cls = py::check(PyType_GetName(Py_TYPE(as_object(self))));
  PyErr_Format(PyExc_ValueError, msg::kUndeclaredSignal, signal, cls.get());
  py::throw_error();
}

void require_callable(py::Borrowed f, const char *message) {
  if (!PyCallable_Check(f.get())) {
    PyErr_Format(PyExc_TypeError, message, Py_TYPE(f.get())->tp_name);
    py::throw_error();
  }
}

CDestroyableObject *require_owner(py::Borrowed owner) {
  if (!is_destroyable(owner.get())) {
    PyErr_Format(PyExc_TypeError, msg::kOwnerNotDestroyable, Py_TYPE(owner.get())->tp_name);
    py::throw_error();
  }
  return as_destroyable(owner.get());
}

// ---- the two ends of a while-alive connection --------------------------------

void owned_add(CDestroyableObject *owner, py::Borrowed conn) {
  if (!owner->owned)
    set_field(owner->owned, py::new_dict());
  py::Ref owned = py::Ref::borrow(owner->owned);
  py::dict_set(owned, fields(conn.get()).id_obj, conn);
}

// The emitter side let go of conn: end it and drop the owner's record.
void forget_on_owner(PyObject *conn) {
  ConnectionFields &f = fields(conn);
  f.active = false;
  py::Ref owner = deref(f.owner);
  if (!owner)
    return;
  CDestroyableObject *o = as_destroyable(owner.get());
  if (!o->owned)
    return;
  py::Ref owned = py::Ref::borrow(o->owned);
  PyObject *record = PyDict_GetItemWithError(owned.get(), f.id_obj.get());
  if (record == conn)
    py::dict_del(owned, f.id_obj);
  else if (!record && PyErr_Occurred())
    py::throw_error();
}

// The owner side let go of conn: end it and remove it from its emitter.
void end_on_emitter(PyObject *conn) {
  ConnectionFields &f = fields(conn);
  f.active = false;
  if (f.kind == Kind::Class) {
    unregister_class_connection(conn);
    return;
  }
  py::Ref emitter = deref(f.emitter);
  if (!emitter)
    return;
  if (f.kind == Kind::Instance) {
    CDestroyableObject *e = as_destroyable(emitter.get());
    if (e->signal_catchers)
      remove_handler(py::Ref::borrow(e->signal_catchers), f.signal, conn);
  }
}

// Drop every handler of self's signals; their owners forget them.
void drop_handlers(CDestroyableObject *self, FirstError &err) {
  py::Ref catchers = take_field(self->signal_catchers);
  if (!catchers)
    return;
  std::vector<py::Ref> conns;
  err.run([&] { conns = all_connections(catchers.get()); }, nullptr);
  for (const py::Ref &c : conns)
    err.run([&] { forget_on_owner(c.get()); }, c.get());
}

void call_destroy_impl(PyObject *self) {
  // The base implementation does nothing; only a subclass can have more.
  if (Py_IS_TYPE(self, &CDestroyable_Type))
    return;
  py::call_method(py::Borrowed(self), g->destroy_impl_name);
}

// Connection of self's signal (a declared name); with an owner it ends when
// the owner does.
py::Ref connect_impl(CDestroyableObject *self, py::Borrowed signal, py::Borrowed callback,
                     CDestroyableObject *owner) {
  py::Borrowed self_obj(as_object(self));
  py::Borrowed owner_obj(owner ? as_object(owner) : nullptr);
  py::Ref conn = new_connection(Kind::Instance, signal, callback, owner ? self_obj : py::Borrowed(),
                                owner_obj);
  if (!self->signal_catchers)
    set_field(self->signal_catchers, py::new_dict());
  py::Ref catchers = py::Ref::borrow(self->signal_catchers);
  add_handler(catchers, signal, conn);
  if (owner) {
    try {
      owned_add(owner, conn);
    } catch (...) {
      ErrorStash stash;
      try {
        remove_handler(catchers, signal, conn.get());
      } catch (...) {
      }
      throw;
    }
  }
  return fields(conn.get()).id_obj;
}

} // namespace

// ---- module-level set-up -------------------------------------------------------

namespace {
void make_globals() {
  auto globals = std::make_unique<Globals>();
  globals->destroy_impl_name = PY_NAME("_destroy_impl");
  globals->class_gone = py::check(PyCFunction_New(&class_gone_def, nullptr));
  g = globals.release();
}
} // namespace

int init_globals() {
  if (g)
    return 0;
  PY_GUARD(-1, make_globals(); return 0;)
}

// ---- CDestroyable operations -----------------------------------------------------

void init(CDestroyableObject *self, py::Borrowed signals) {
  py::Ref names;
  if (!signals) {
    names = py::check(PyTuple_New(0));
  } else {
    if (PyUnicode_Check(signals.get()) || PyBytes_Check(signals.get())) {
      PyErr_Format(PyExc_TypeError, msg::kSignalsIsString, Py_TYPE(signals.get())->tp_name);
      py::throw_error();
    }
    py::Ref given = py::check(PySequence_Tuple(signals.get()));
    const Py_ssize_t n = PyTuple_GET_SIZE(given.get());
    names = py::check(PyTuple_New(n));
    for (Py_ssize_t i = 0; i < n; ++i) {
      PyTuple_SET_ITEM(names.get(), i, signal_name(PyTuple_GET_ITEM(given.get(), i)).release());
    }
  }
  set_field(self->declared_signals, std::move(names));
  self->initialised = 1;
}

void emit(CDestroyableObject *self, py::Borrowed signal, PyObject *const *args, Py_ssize_t nargs) {
  PyObject *name = declared_name(self, signal.get());

  Snapshot handlers;
  if (PyObject *catchers = self->signal_catchers) {
    PyObject *list = PyDict_GetItemWithError(catchers, name);
    if (list)
      handlers.add_list(list);
    else if (PyErr_Occurred())
      py::throw_error();
  }
  if (!registry().empty()) {
    // Most derived class first.  No Python code runs during this walk.
    PyObject *mro = Py_TYPE(as_object(self))->tp_mro;
    for (Py_ssize_t i = 0; mro && i < PyTuple_GET_SIZE(mro); ++i) {
      auto it = registry().find(reinterpret_cast<PyTypeObject *>(PyTuple_GET_ITEM(mro, i)));
      if (it == registry().end())
        continue;
      for (PyObject *conn : it->second.conns)
        if (same_signal(fields(conn).signal.get(), name))
          handlers.add(conn);
    }
  }

  for (std::size_t i = 0; i < handlers.size(); ++i) {
    ConnectionFields &f = fields(handlers[i]);
    if (!f.active || !f.callback)
      continue;
    py::Ref callback = f.callback; // the record may be cleared while it runs
    py::check(PyObject_Vectorcall(callback.get(), args, static_cast<size_t>(nargs), nullptr));
  }
}

py::Ref connect(CDestroyableObject *self, py::Borrowed signal, py::Borrowed callback) {
  py::Ref name = py::Ref::borrow(declared_name(self, signal.get()));
  require_callable(callback, msg::kCallbackNotCallable);
  return connect_impl(self, name, callback, nullptr);
}

py::Ref connect_while_alive(CDestroyableObject *self, py::Borrowed signal, py::Borrowed callback,
                            py::Borrowed owner) {
  py::Ref name = py::Ref::borrow(declared_name(self, signal.get()));
  require_callable(callback, msg::kCallbackNotCallable);
  CDestroyableObject *o = require_owner(owner);
  if (o->destroyed)
    return py::Ref::none();
  return connect_impl(self, name, callback, o);
}

void disconnect(CDestroyableObject *self, py::Borrowed id) {
  long long want;
  if (!id_value(id, &want) || !self->signal_catchers)
    return;
  py::Ref catchers = py::Ref::borrow(self->signal_catchers);
  py::Ref conn = find_by_id(catchers.get(), want);
  if (!conn)
    return;
  remove_handler(catchers, fields(conn.get()).signal, conn.get());
  forget_on_owner(conn.get());
}

py::Ref class_connect_while_alive(PyTypeObject *cls, py::Borrowed signal, py::Borrowed callback,
                                  py::Borrowed owner) {
  py::Ref name = signal_name(signal.get());
  require_callable(callback, msg::kCallbackNotCallable);
  CDestroyableObject *o = require_owner(owner);
  if (o->destroyed)
    return py::Ref::none();
  py::Ref conn = new_connection(Kind::Class, name, callback, py::Borrowed(), owner);
  // The owner's record is the strong reference; the registry only borrows.
  owned_add(o, conn);
  try {
    auto it = registry().find(cls);
    if (it == registry().end()) {
      ClassEntry entry;
      entry.type_weakref =
          py::check(PyWeakref_NewRef(reinterpret_cast<PyObject *>(cls), g->class_gone.get()));
      it = registry().emplace(cls, std::move(entry)).first;
    }
    it->second.conns.push_back(conn.get());
    fields(conn.get()).registered_in = cls;
  } catch (...) {
    ErrorStash stash;
    try {
      forget_on_owner(conn.get());
    } catch (...) {
    }
    throw;
  }
  return fields(conn.get()).id_obj;
}

void class_disconnect(py::Borrowed id) {
  long long want;
  if (!id_value(id, &want))
    return;
  py::Ref conn;
  for (auto &kv : registry()) {
    for (PyObject *c : kv.second.conns) {
      if (fields(c).id == want) {
        conn = py::Ref::borrow(c);
        break;
      }
    }
    if (conn)
      break;
  }
  if (!conn)
    return;
  fields(conn.get()).active = false;
  unregister_class_connection(conn.get());
  forget_on_owner(conn.get());
}

void unregister_class_connection(PyObject *conn) noexcept {
  ConnectionFields &f = fields(conn);
  if (!f.registered_in)
    return;
  auto it = registry().find(f.registered_in);
  f.registered_in = nullptr;
  if (it == registry().end())
    return;
  std::vector<PyObject *> &conns = it->second.conns;
  for (auto c = conns.begin(); c != conns.end(); ++c) {
    if (*c == conn) {
      conns.erase(c);
      break;
    }
  }
  if (conns.empty()) {
    // Released after the map is consistent again; dropping a weakref runs no
    // Python code.
    ClassEntry dead = std::move(it->second);
    registry().erase(it);
  }
}

void forget_class(py::Borrowed weakref) {
  FirstError err;
  std::vector<py::Ref> conns;
  for (auto it = registry().begin(); it != registry().end(); ++it) {
    if (it->second.type_weakref.get() != weakref.get())
      continue;
    err.run(
        [&] {
          for (PyObject *c : it->second.conns)
            conns.push_back(py::Ref::borrow(c));
        },
        nullptr);
    for (PyObject *c : it->second.conns)
      fields(c).registered_in = nullptr;
    ClassEntry dead = std::move(it->second);
    registry().erase(it);
    break;
  }
  for (const py::Ref &c : conns)
    err.run([&] { forget_on_owner(c.get()); }, c.get());
  err.rethrow();
}

void destroy(CDestroyableObject *self) {
  if (self->destroyed)
    return;
  self->destroyed = 1; // from here on, new while-alive connections and hooks are refused
  PyObject *obj = as_object(self);
  // Hooks and handlers may drop every other reference to self.
  py::Ref keep = py::Ref::borrow(obj);

  FirstError err;
  err.run([&] { call_destroy_impl(obj); }, obj);

  if (self->owned) {
    // `owned` stays in place while the hooks run so that one hook can still
    // unregister another; iterate a snapshot and skip what ended meanwhile.
    py::Ref owned = py::Ref::borrow(self->owned);
    std::vector<py::Ref> records;
    err.run([&] { records = owned_records(owned.get()); }, obj);
    for (const py::Ref &c : records)
      if (fields(c.get()).kind != Kind::Hook)
        err.run([&] { end_on_emitter(c.get()); }, c.get());
    for (const py::Ref &c : records) {
      ConnectionFields &f = fields(c.get());
      if (f.kind != Kind::Hook || !f.active)
        continue;
      f.active = false;
      py::Ref hook = f.callback;
      if (hook)
        err.run([&] { py::call(hook); }, hook.get());
    }
    if (self->owned == owned.get())
      take_field(self->owned);
  }

  drop_handlers(self, err);
  err.rethrow();
}

py::Ref register_destroy_hook(CDestroyableObject *self, py::Borrowed hook) {
  require_callable(hook, msg::kHookNotCallable);
  if (self->destroyed) {
    py::call(hook);
    return py::Ref::none();
  }
  py::Ref conn = new_connection(Kind::Hook, py::Borrowed(), hook, py::Borrowed(), py::Borrowed());
  owned_add(self, conn);
  return fields(conn.get()).id_obj;
}

void unregister_destroy_hook(CDestroyableObject *self, py::Borrowed token) {
  if (!self->owned || !PyLong_Check(token.get()))
    return;
  py::Ref owned = py::Ref::borrow(self->owned);
  py::Ref record = py::dict_get(owned, token);
  if (!record || !is_connection(record.get()) || fields(record.get()).kind != Kind::Hook)
    return;
  fields(record.get()).active = false;
  py::dict_del(owned, token);
}

void clear_state(CDestroyableObject *self, bool dealloc) noexcept {
  ErrorStash stash;
  FirstError err;
  drop_handlers(self, err);

  // An owner that goes away without destroy() still ends its connections
  // (their owner is gone); its hooks are dropped without being called.
  py::Ref owned = take_field(self->owned);
  if (owned) {
    std::vector<py::Ref> records;
    err.run([&] { records = owned_records(owned.get()); }, nullptr);
    for (const py::Ref &c : records) {
      fields(c.get()).active = false;
      if (fields(c.get()).kind != Kind::Hook)
        err.run([&] { end_on_emitter(c.get()); }, c.get());
    }
  }
  if (dealloc)
    take_field(self->declared_signals);
  err.write_unraisable();
}

Py_ssize_t owned_count(CDestroyableObject *self) {
  return self->owned ? PyDict_GET_SIZE(self->owned) : 0;
}

std::size_t class_registry_size() { return registry().size(); }

} // namespace destroyable
