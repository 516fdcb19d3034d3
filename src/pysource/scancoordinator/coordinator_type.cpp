// CScanCoordinator: the class object.
//
// The coordinator derives from the host's CDestroyable like the queue
// classes.  Its construction, lifecycle and scanning operations are not part
// of this build yet: constructing one raises NotImplementedError rather than
// returning an object that would silently do nothing.
#include "pysource/scancoordinator/module.hpp"
#include "pysource/scancoordinator/types.hpp"
#include "pysource/scancoordinator/typeutil.hpp"
#include "host/objectmodel.hpp"

namespace scancoord {

namespace {

struct Fields {
  int visit(visitproc, void *) const { return 0; }
  void clear() {}
};
struct Obj {
  CDestroyableObject base;
  Fields f;
};

constexpr const char *kNotAvailable = "CScanCoordinator is not available in this build yet";

PyObject *tp_new(PyTypeObject *, PyObject *, PyObject *) {
  PyErr_SetString(PyExc_NotImplementedError, kNotAvailable);
  return nullptr;
}

PyType_Slot slots[] = {{Py_tp_doc, const_cast<char *>("Class to coordinate scanning of files")},
                       {Py_tp_new, reinterpret_cast<void *>(tp_new)},
                       {Py_tp_dealloc, reinterpret_cast<void *>(typed_dealloc<Obj>)},
                       {Py_tp_traverse, reinterpret_cast<void *>(typed_traverse<Obj>)},
                       {Py_tp_clear, reinterpret_cast<void *>(typed_clear<Obj>)},
                       {0, nullptr}};

PyType_Spec spec = {"pysource.scancoordinator.CScanCoordinator",
                    static_cast<int>(sizeof(Obj)), 0,
                    Py_TPFLAGS_DEFAULT | Py_TPFLAGS_BASETYPE | Py_TPFLAGS_HAVE_GC, slots};

} // namespace

PyTypeObject *create_coordinator_type(py::Borrowed module) {
  py::Ref base = py::Ref::borrow(reinterpret_cast<PyObject *>(host::objectmodel::base_type()));
  py::Ref type = py::check(PyType_FromModuleAndSpec(module.get(), &spec, base.get()));
  return reinterpret_cast<PyTypeObject *>(type.release());
}

} // namespace scancoord
