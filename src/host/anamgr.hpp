// The analysis manager and its factory, as the coordinator reads them.  Scan
// names are read at each use and never cached: the host may change them.
#pragma once

#include "host/pyref.hpp"

namespace host::anamgr {

py::Ref PrimaryScanName(py::Borrowed ana_mgr);
py::Ref DerivedScanName(py::Borrowed ana_mgr);
// len(ana_mgr.fPyConfig.python_path_locs)
Py_ssize_t PythonPathLength(py::Borrowed ana_mgr);
py::Ref AnalysisFactory(py::Borrowed ana_mgr);
// ana_mgr.fHelperProcessProxy (None when no helper process runs)
py::Ref HelperProcessProxy(py::Borrowed ana_mgr);

} // namespace host::anamgr
