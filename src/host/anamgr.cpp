// The analysis manager and its factory.
#include "host/anamgr.hpp"

namespace host::anamgr {

py::Ref PrimaryScanName(py::Borrowed m) { return py::getattr(m, PY_NAME("fPrimaryScanName")); }
py::Ref DerivedScanName(py::Borrowed m) { return py::getattr(m, PY_NAME("fDerivedScanName")); }
Py_ssize_t PythonPathLength(py::Borrowed m) {
  py::Ref locs = py::getattr(py::getattr(m, PY_NAME("fPyConfig")), PY_NAME("python_path_locs"));
  Py_ssize_t n = PyObject_Size(locs.get());
  if (n < 0)
    py::throw_error();
  return n;
}
py::Ref AnalysisFactory(py::Borrowed m) { return py::getattr(m, PY_NAME("fAnalysisFactory")); }
py::Ref HelperProcessProxy(py::Borrowed m) {
  return py::getattr(m, PY_NAME("fHelperProcessProxy"));
}

} // namespace host::anamgr
