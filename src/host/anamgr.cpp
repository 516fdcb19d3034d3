// The analysis manager and its factory.
#include "host/anamgr.hpp"

namespace host::anamgr {

namespace {
py::Ref attr(py::Borrowed o, const char *name) { return py::getattr(o, py::interned(name)); }
} // namespace

py::Ref PrimaryScanName(py::Borrowed m) {
  static py::Ref *n = new py::Ref(py::interned("fPrimaryScanName"));
  return py::getattr(m, *n);
}
py::Ref DerivedScanName(py::Borrowed m) {
  static py::Ref *n = new py::Ref(py::interned("fDerivedScanName"));
  return py::getattr(m, *n);
}
Py_ssize_t PythonPathLength(py::Borrowed m) {
  py::Ref locs = attr(attr(m, "fPyConfig"), "python_path_locs");
  Py_ssize_t n = PyObject_Size(locs.get());
  if (n < 0)
    py::throw_error();
  return n;
}
py::Ref AnalysisFactory(py::Borrowed m) { return attr(m, "fAnalysisFactory"); }
py::Ref HelperProcessProxy(py::Borrowed m) { return attr(m, "fHelperProcessProxy"); }

} // namespace host::anamgr
