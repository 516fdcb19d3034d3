// The helper process proxy.
#include "host/helperprocess.hpp"

namespace host::helperprocess {

namespace {
py::Ref kw(py::Borrowed name) { return py::check(PyTuple_Pack(1, name.get())); }
} // namespace

void AddPairsToPrimaryQueue(py::Borrowed proxy, py::Borrowed pairs, py::Borrowed first) {
  static py::Ref *kwnames = new py::Ref(kw(PY_NAME("callback")));
  py::Ref meth = py::getattr(proxy, PY_NAME("AddPairsToPrimaryQueue"));
  PyObject *argv[] = {pairs.get(), first.get(), Py_None};
  py::call_kw(meth, argv, 2, *kwnames);
}

void AddPairsToPrimaryQueueAt(py::Borrowed proxy, py::Borrowed pairs, py::Borrowed priority) {
  static py::Ref *kwnames = new py::Ref(kw(PY_NAME("priority")));
  py::Ref meth = py::getattr(proxy, PY_NAME("AddPairsToPrimaryQueue"));
  PyObject *argv[] = {pairs.get(), priority.get()};
  py::call_kw(meth, argv, 1, *kwnames);
}

void FlushQueue(py::Borrowed proxy) {
  static py::Ref *kwnames = new py::Ref(kw(PY_NAME("callback")));
  py::Ref meth = py::getattr(proxy, PY_NAME("FlushQueue"));
  PyObject *argv[] = {Py_None};
  py::call_kw(meth, argv, 0, *kwnames);
}

} // namespace host::helperprocess
