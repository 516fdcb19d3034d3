/* The C face of the host's destroyable base class (ostrelbase.destroyable).
 *
 * The base type lives in its own extension module.  Other extension modules
 * derive heap types from it across the module boundary; they get the type and
 * a few C entry points from the capsule named CDESTROYABLE_CAPSULE_NAME,
 * which the exporting module stores in its namespace as `_C_API`.
 *
 * Layout contract: an instance starts with CDestroyableObject; derived C
 * types put their own fields after it.  The importer checks `abi_version`
 * and `object_size` against what it was compiled with and refuses to load
 * on a mismatch, so a stale build can never scribble over the base's fields.
 */
#ifndef OSTREL_DESTROYABLE_CAPI_H
#define OSTREL_DESTROYABLE_CAPI_H

#define PY_SSIZE_T_CLEAN
#include <Python.h>

#ifdef __cplusplus
extern "C" {
#endif

#define CDESTROYABLE_CAPSULE_NAME "ostrelbase.destroyable._C_API"
#define CDESTROYABLE_ABI_VERSION 1u

typedef struct {
  PyObject_HEAD PyObject *weakreflist;
  /* tuple of the signal names this instance may emit (given to __init__) */
  PyObject *declared_signals;
  /* dict: signal name -> list of connections; NULL until the first connect */
  PyObject *signal_catchers;
  /* what must end when this object is destroyed (connections, idles and
     timeouts made "while alive" with this object as owner); implementation's */
  PyObject *owned;
  char destroyed;
  char always_destroy_on_main_thread;
  char initialised;
} CDestroyableObject;

typedef struct {
  unsigned int abi_version;
  size_t object_size; /* sizeof(CDestroyableObject) in the exporting module */
  PyTypeObject *type; /* the CDestroyable type (borrowed; the module keeps it) */

  /* CDestroyable.__init__(self, signals); signals may be NULL for none.
     Returns 0, or -1 with an exception set. */
  int (*init)(PyObject *self, PyObject *signals);

  /* self.emit(signal, *args).  Returns 0, or -1 with an exception set. */
  int (*emit)(PyObject *self, PyObject *signal, PyObject *const *args, Py_ssize_t nargs);

  /* self.connect_while_alive(signal, callback, owner): new reference to the
     connection id, or NULL with an exception set. */
  PyObject *(*connect_while_alive)(PyObject *self, PyObject *signal, PyObject *callback,
                                   PyObject *owner);

  /* self.destroy() (runs the overridable _destroy_impl once).
     Returns 0, or -1 with an exception set. */
  int (*destroy)(PyObject *self);

  /* 1 once destroy() has started, else 0. */
  int (*is_destroyed)(PyObject *self);
} CDestroyable_CAPI;

#ifdef __cplusplus
}
#endif

#endif /* OSTREL_DESTROYABLE_CAPI_H */
