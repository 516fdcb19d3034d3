// _CSingleScanQueue: one bucket of the scan queue.
//
// All scans in one single queue share the same priority and scan order; the
// scan name attached is carried along and reported, but decides nothing.
// fOrderedDict maps each location to its name list: a plain list of scope
// names, never empty while stored, distinct and sorted (so the scan queue can
// bisect it), holding only '*' when the whole file is queued.  The order of
// locations in the mapping is the order work is handed out; only the scan
// queue changes it, through the `first` flag of the mapping's get and Set.
// The single queue has no behaviour beyond construction.
#include "pysource/scancoordinator/module.hpp"
#include "pysource/scancoordinator/typeutil.hpp"
#include "pysource/scancoordinator/types.hpp"
#include "host/orderedmap.hpp"

#include <vector>

namespace scancoord {

namespace {

struct Fields : SingleQueueFields {
  int visit(visitproc v, void *arg) const {
    if (int r = fScanName.visit(v, arg))
      return r;
    return fOrderedDict.visit(v, arg);
  }
  void clear() {
    fScanName.reset();
    fOrderedDict.reset();
  }
};
static_assert(sizeof(Fields) == sizeof(SingleQueueFields));

struct Obj {
  CDestroyableObject base;
  Fields f;
};

const char kDoc[] =
    "One queue of scans of a single priority and scan order.\n\n"
    "All scans in one single queue are of the same priority and order; the scan name\n"
    "attached is not used to determine anything.  fOrderedDict maps locations to a sorted\n"
    "list of scopes to scan; the order of locations is set by moving items in the ordered\n"
    "dictionary.  Scopes are always kept in alphabetical order so that binary searches can\n"
    "be used.  A scope name of '*' stands for all scopes and is then the only item in the\n"
    "list.";

// _CSingleScanQueue(scan_name, priority, order)
void init_fields(Obj *self, py::Borrowed scan_name, long long priority, long long order) {
  self->f.fScanName = scan_name.ref();
  self->f.fPriority = priority;
  self->f.fOrder = order;
  self->f.fOrderedDict = host::orderedmap::create();
}

int tp_init(PyObject *self, PyObject *args, PyObject *kwds){
    PY_GUARD(-1,
             {
               static const char *const names[] = {"scan_name", "priority", "order"};
               static PyObject *const *const keys = intern_names(names, 3);
               // Route through the vectorcall-style parser for identical messages.
               Py_ssize_t nargs = PyTuple_GET_SIZE(args);
               py::Ref kwnames;
               PyObject **items = PySequence_Fast_ITEMS(args);
               std::vector<PyObject *> argv(items, items + nargs);
               if (kwds && PyDict_GET_SIZE(kwds)) {
                 kwnames = py::check(PyTuple_New(PyDict_GET_SIZE(kwds)));
                 Py_ssize_t pos = 0, i = 0;
                 PyObject *k, *v;
                 while (PyDict_Next(kwds, &pos, &k, &v)) {
                   PyTuple_SET_ITEM(kwnames.get(), i++, py::Ref::borrow(k).release());
                   argv.push_back(v);
                 }
               }
               PyObject *out[3];
               parse_args("__init__", argv.data(), nargs, kwnames.get(), keys, 3, 3, out);
               // The base class first, with no signals: a single queue emits nothing.
               host::objectmodel::base_init(py::Borrowed(self), py::Borrowed());
               auto *obj = reinterpret_cast<Obj *>(self);
               obj->f.fScanName = py::Ref::borrow(out[0]);
               obj->f.fPriority = as_int64(py::Borrowed(out[1]));
               obj->f.fOrder = as_int64(py::Borrowed(out[2]));
               obj->f.fOrderedDict = host::orderedmap::create();
               return 0;
             })}

PyObject *get_priority(PyObject *self, void *) {
  return PyLong_FromLongLong(reinterpret_cast<Obj *>(self)->f.fPriority);
}
PyObject *get_order(PyObject *self, void *) {
  return PyLong_FromLongLong(reinterpret_cast<Obj *>(self)->f.fOrder);
}

PyGetSetDef getset[] = {
    {"fScanName", SC_REF_GETTER(Obj, fScanName), nullptr, nullptr, nullptr},
    {"fPriority", get_priority, nullptr, nullptr, nullptr},
    {"fOrder", get_order, nullptr, nullptr, nullptr},
    {"fOrderedDict", SC_REF_GETTER(Obj, fOrderedDict), nullptr, nullptr, nullptr},
    {nullptr, nullptr, nullptr, nullptr, nullptr}};

PyType_Slot slots[] = {{Py_tp_doc, const_cast<char *>(kDoc)},
                       {Py_tp_new, reinterpret_cast<void *>(typed_new<Obj>)},
                       {Py_tp_init, reinterpret_cast<void *>(tp_init)},
                       {Py_tp_dealloc, reinterpret_cast<void *>(typed_dealloc<Obj>)},
                       {Py_tp_traverse, reinterpret_cast<void *>(typed_traverse<Obj>)},
                       {Py_tp_clear, reinterpret_cast<void *>(typed_clear<Obj>)},
                       {Py_tp_getset, getset},
                       {0, nullptr}};

PyType_Spec spec = {"pysource.scancoordinator._CSingleScanQueue", sizeof(Obj), 0,
                    Py_TPFLAGS_DEFAULT | Py_TPFLAGS_BASETYPE | Py_TPFLAGS_HAVE_GC, slots};

} // namespace

PyTypeObject *create_single_queue_type(py::Borrowed module) {
  return create_derived_type(module, &spec);
}

py::Ref new_single_queue(py::Borrowed scan_name, long long priority, long long order) {
  PyTypeObject *type = state->SingleQueueType;
  static py::Ref *no_args = new py::Ref(py::check(PyTuple_New(0)));
  py::Ref self = py::check(typed_new<Obj>(type, no_args->get(), nullptr));
  host::objectmodel::base_init(self, py::Borrowed());
  init_fields(reinterpret_cast<Obj *>(self.get()), scan_name, priority, order);
  return self;
}

SingleQueueObject *as_single_queue(PyObject *o) {
  if (!PyObject_TypeCheck(o, state->SingleQueueType)) {
    PyErr_Format(PyExc_TypeError, msg::kExpectedType, "_CSingleScanQueue", Py_TYPE(o)->tp_name);
    py::throw_error();
  }
  return reinterpret_cast<SingleQueueObject *>(o);
}

} // namespace scancoord
