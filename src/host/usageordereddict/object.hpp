// What the Python face of CUsageOrderedDict shares between its units: the
// instance layout and the private benchmark entry point.
//
// The Table lives in raw aligned storage inside the instance so that the
// struct stays standard-layout (offsetof of the weakref slot is then well
// defined); module.cpp constructs it in tp_new and destroys it in tp_dealloc,
// and nothing else may touch the storage outside that window.
#pragma once

#include "host/pyref.hpp"
#include "host/usageordereddict/table.hpp"

#include <new>

namespace uod {

struct UodObject {
  PyObject ob_base;
  PyObject *weakreflist; // managed by CPython (PyObject_ClearWeakRefs)
  alignas(Table) unsigned char table_storage[sizeof(Table)];
};

inline Table &table_of(PyObject *self) noexcept {
  return *std::launder(
      reinterpret_cast<Table *>(reinterpret_cast<UodObject *>(self)->table_storage));
}

// _bench_capi(op, keys, values, probe_keys, dict_first) in bench_capi.cpp.
PyObject *bench_capi(PyObject *module, PyObject *const *args, Py_ssize_t nargs);

} // namespace uod
