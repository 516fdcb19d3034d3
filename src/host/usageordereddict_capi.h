/* The C face of the host's usage-ordered mapping (pysource.usageordereddict).
 *
 * CUsageOrderedDict is a mapping whose entries are kept in a doubly linked
 * order that callers steer: an entry can be stored at either end and moved
 * to the front when looked up.  Lookup, move-to-front, insertion at either
 * end and removal are all constant time.
 *
 * Modules that use the mapping on a hot path fetch this table from the
 * capsule CUSAGEORDEREDDICT_CAPSULE_NAME (stored in the module as `_C_API`)
 * and, for an object whose type is exactly `type`, call these functions
 * instead of going through attribute lookup.  Subclasses must still be used
 * through their Python methods so that overrides are honoured.
 */
#ifndef PYSOURCE_USAGEORDEREDDICT_CAPI_H
#define PYSOURCE_USAGEORDEREDDICT_CAPI_H

#define PY_SSIZE_T_CLEAN
#include <Python.h>

#ifdef __cplusplus
extern "C" {
#endif

#define CUSAGEORDEREDDICT_CAPSULE_NAME "pysource.usageordereddict._C_API"
#define CUSAGEORDEREDDICT_ABI_VERSION 1u

typedef struct {
  unsigned int abi_version;
  PyTypeObject *type; /* CUsageOrderedDict (borrowed; the module keeps it) */

  /* New empty mapping (new reference), or NULL with an exception set. */
  PyObject *(*create)(void);

  /* d.get(key, None, first): the value as a BORROWED reference, or NULL when
     absent.  When `first` is nonzero an existing entry moves to the front.
     On error returns NULL with an exception set: callers distinguish with
     PyErr_Occurred(). */
  PyObject *(*get)(PyObject *d, PyObject *key, int first);

  /* d.Set(key, value, first=first): store at the front (first nonzero) or
     at the back.  Replacing the value of an existing key also moves the entry
     to the requested end.  Returns 0, or -1 with an exception set. */
  int (*set)(PyObject *d, PyObject *key, PyObject *value, int first);

  /* d.pop(key, default) without a default: the removed value as a NEW
     reference, or NULL when absent (no exception) or on error (exception
     set). */
  PyObject *(*pop)(PyObject *d, PyObject *key);

  /* del d[key]: 0 when removed, -1 with KeyError (or another error) set. */
  int (*del)(PyObject *d, PyObject *key);

  /* len(d) */
  Py_ssize_t (*size)(PyObject *d);

  /* The first entry's key and value as BORROWED references; returns 0 and
     leaves the outputs NULL when the mapping is empty. */
  int (*first)(PyObject *d, PyObject **key, PyObject **value);
} CUsageOrderedDict_CAPI;

#ifdef __cplusplus
}
#endif

#endif /* PYSOURCE_USAGEORDEREDDICT_CAPI_H */
