// Private interface between the three units of the ostrelbase.destroyable
// module:
//
//   connection.cpp   the internal `_Connection` record type (one per signal
//                    connection or destroy hook) and the process-wide ids;
//   destroyable.cpp  the logic of CDestroyable: declared signals, connecting,
//                    emitting, destroying, the class-wide registry;
//   module.cpp       the Python face: the CDestroyable type object, its slots,
//                    method and getset tables, the capsule and module init.
//
// The logic functions take the C layout (CDestroyableObject) and report
// errors by throwing py::PyError with the Python exception set; module.cpp
// turns that back into NULL / -1 at every entry from Python (PY_GUARD).
#pragma once

#include "host/destroyable_capi.h"
#include "host/pyref.hpp"

#include <cstddef>

namespace destroyable {

// ---- message texts --------------------------------------------------------
// Every user-visible message of the module; tests assert them verbatim.
namespace msg {
// %R: the signal as given; %U: the __name__ of the instance's class.
inline constexpr char kUndeclaredSignal[] = "Signal %R is not declared by %U";
// A plain string is itself a sequence of strings; refusing it catches
// CDestroyable("changed") meaning ("changed",).
inline constexpr char kSignalsIsString[] =
    "signals must be a sequence of signal names, not a single %.100s";
inline constexpr char kSignalNameNotStr[] = "signal names must be str, not %.100s";
inline constexpr char kCallbackNotCallable[] = "callback must be callable, not %.100s";
inline constexpr char kHookNotCallable[] = "destroy hook must be callable, not %.100s";
inline constexpr char kOwnerNotDestroyable[] = "owner must be a CDestroyable, not %.100s";
inline constexpr char kEmitWithoutSignal[] = "emit() missing required argument 'signal'";
inline constexpr char kNotDestroyable[] = "expected a CDestroyable instance, not %.100s";
} // namespace msg

// ---- the CDestroyable type ------------------------------------------------
extern PyTypeObject CDestroyable_Type;

inline CDestroyableObject *as_destroyable(PyObject *o) {
  return reinterpret_cast<CDestroyableObject *>(o);
}
inline bool is_destroyable(PyObject *o) { return PyObject_TypeCheck(o, &CDestroyable_Type); }

// ---- connections ----------------------------------------------------------
// One record per connection or destroy hook.  An instance connection is
// referenced strongly by the emitter's handler list and, when it has an
// owner, by the owner's `owned` dict; it reaches each of them only through a
// weak reference, so neither keeps the other alive.  A class-wide connection
// is referenced strongly only by its owner's `owned` dict: the class-wide
// registry borrows it, and the record takes itself out of the registry before
// it can die (see unregister_class_connection).
enum class Kind : unsigned char {
  Instance, // handler of a signal of one instance
  Class,    // handler of a signal of every instance of a class
  Hook,     // destroy hook: called with no arguments when its owner is destroyed
};

struct ConnectionFields {
  long long id = 0;
  Kind kind = Kind::Instance;
  // Cleared when the connection ends, so that an emission iterating a
  // snapshot skips a handler disconnected while it was running.
  bool active = true;
  py::Ref id_obj;   // the id as a Python int: handed out, and the key in `owned`
  py::Ref signal;   // NULL for hooks
  py::Ref callback; // the handler, or the hook
  py::Ref emitter;  // weakref to the emitting instance (while-alive only)
  py::Ref owner;    // weakref to the owner (while-alive only)
  // Class-wide connections: the registry key of the class whose entry
  // borrows this record, or NULL once it is out of the registry.
  PyTypeObject *registered_in = nullptr;
};

struct ConnectionObject {
  PyObject_HEAD ConnectionFields f;
};

extern PyTypeObject Connection_Type;

inline bool is_connection(PyObject *o) { return Py_IS_TYPE(o, &Connection_Type); }
inline ConnectionFields &fields(PyObject *conn) {
  return reinterpret_cast<ConnectionObject *>(conn)->f;
}

// Fill and ready the internal type (idempotent).  Returns -1 on error.
int ready_connection_type();

// A new tracked connection with a fresh process-wide id.  `emitter` and
// `owner` may be null; when given, only weak references to them are kept.
py::Ref new_connection(Kind kind, py::Borrowed signal, py::Borrowed callback, py::Borrowed emitter,
                       py::Borrowed owner);

// The object a weak reference points to, or an empty Ref when it is dead or
// being deallocated (a subclass clears its own fields before the base clears
// the weak references, so a referent with no references left must count as
// dead).
py::Ref deref(const py::Ref &weakref);

// ---- the logic (destroyable.cpp) ------------------------------------------
// Names and callables created once at module init.
int init_globals();

void init(CDestroyableObject *self, py::Borrowed signals);
void emit(CDestroyableObject *self, py::Borrowed signal, PyObject *const *args, Py_ssize_t nargs);
py::Ref connect(CDestroyableObject *self, py::Borrowed signal, py::Borrowed callback);
py::Ref connect_while_alive(CDestroyableObject *self, py::Borrowed signal, py::Borrowed callback,
                            py::Borrowed owner);
void disconnect(CDestroyableObject *self, py::Borrowed id);
py::Ref class_connect_while_alive(PyTypeObject *cls, py::Borrowed signal, py::Borrowed callback,
                                  py::Borrowed owner);
void class_disconnect(py::Borrowed id);
void destroy(CDestroyableObject *self);
py::Ref register_destroy_hook(CDestroyableObject *self, py::Borrowed hook);
void unregister_destroy_hook(CDestroyableObject *self, py::Borrowed token);

// Called from the weakref callback when a class with class-wide connections
// dies.
void forget_class(py::Borrowed weakref);

// Take a class-wide connection out of the registry (no-op when it is not
// in).  Runs no Python code and cannot fail: the connection's own tp_clear
// and tp_dealloc call it.
void unregister_class_connection(PyObject *conn) noexcept;

// tp_clear and tp_dealloc: end everything the object holds.  Never raises
// (errors go to sys.unraisablehook) and never takes a reference to self,
// which may already have none.  `dealloc` also drops the declared signals.
void clear_state(CDestroyableObject *self, bool dealloc) noexcept;

// For the test-only accessors.
Py_ssize_t owned_count(CDestroyableObject *self);
std::size_t class_registry_size();

} // namespace destroyable
