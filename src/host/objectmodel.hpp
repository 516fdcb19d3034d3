// Object model and signals: the host's destroyable base class as seen from
// the coordinator's module.
//
// The base type and its C entry points arrive through the capsule exported
// by ostrelbase.destroyable (see destroyable_capi.h).  `import_base()` must
// run once, during module init, before any type of this module is created.
#pragma once

#include "host/destroyable_capi.h"
#include "host/pyref.hpp"

namespace host::objectmodel {

// Import the capsule and check that its layout matches what we compiled
// against.  Throws (ImportError set) on a mismatch.
void import_base();

PyTypeObject *base_type();
const CDestroyable_CAPI &api();

// CDestroyable.__init__(self, signals)
void base_init(py::Borrowed self, py::Borrowed signals);

// self.emit(signal, *args)
template <typename... A> void emit(py::Borrowed self, py::Borrowed signal, A... args) {
  PyObject *argv[sizeof...(A) + 1] = {py::Borrowed(args).get()..., nullptr};
  if (api().emit(self.get(), signal.get(), argv, sizeof...(A)) < 0)
    py::throw_error();
}

// emitter.connect_while_alive(signal, callback, owner) -> connection id
py::Ref connect_while_alive(py::Borrowed emitter, py::Borrowed signal, py::Borrowed callback,
                            py::Borrowed owner);

// obj.destroy()
void destroy(py::Borrowed obj);

// The base part of tp_traverse / tp_clear / tp_dealloc for derived types.
int traverse_base(PyObject *self, visitproc visit, void *arg);
int clear_base(PyObject *self);
void dealloc_base(PyObject *self);

} // namespace host::objectmodel
